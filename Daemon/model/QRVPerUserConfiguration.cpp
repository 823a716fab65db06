#include "model/QRVPerUserConfiguration.h"

#include "base/QRVLog.h"
#include "fs/QRVDictionaryAdditions.h"

namespace {

std::string join(const std::string& a, const std::string& b) { return QRVPathByAppendingComponent(a, b); }

}  // namespace

QRVPerUserConfiguration::QRVPerUserConfiguration(QRVUserIdentityRef userIdentity,
                                                 std::shared_ptr<QRVFileManager> fileManager)
    : userIdentity_(std::move(userIdentity)),
      fileManager_(std::move(fileManager)),
      userHomeDirectory_(userIdentity_->homeDirectoryURL()) {}

std::string QRVPerUserConfiguration::remembered(std::string* slot, const std::string& path,
                                                const char* failureMessage) {
  QRVRecursiveMutexLock lock(&monitor_);
  if (slot->empty()) *slot = path;
  QRVError error;
  if (!fileManager_->createDirectoryAtURLWithOwner(*slot, true, 0755, userIdentity_->posixUID(), &error))
    QRVLogError("{} at \"{}\": {}", failureMessage, *slot, error.description());
  return *slot;
}

std::string QRVPerUserConfiguration::userBaseDirectory() {
  return remembered(&userBaseDirectory_, join(userHomeDirectory_, "Containers"), "Failed to create user base dir");
}

std::string QRVPerUserConfiguration::stagingDirectory() {
  QRVRecursiveMutexLock lock(&monitor_);
  return remembered(&stagingDirectory_, join(userBaseDirectory(), "Staging"), "Failed to create staging dir");
}

std::string QRVPerUserConfiguration::transientDirectory() {
  QRVRecursiveMutexLock lock(&monitor_);
  return remembered(&transientDirectory_, join(userBaseDirectory(), "Temp"), "Failed to create transient dir");
}

std::string QRVPerUserConfiguration::libraryDirectory() {
  return remembered(&libraryDirectory_, join(userHomeDirectory_, "Library/Quorva"),
                    "Failed to create user library dir");
}

std::string QRVPerUserConfiguration::systemContainerBackupBaseDirectory() {
  return join(userHomeDirectory_, "Library/Backup/SystemContainers");
}

std::string QRVPerUserConfiguration::systemContainerBackupDirectory() {
  return join(systemContainerBackupBaseDirectory(), "Data");
}

std::string QRVPerUserConfiguration::systemGroupContainerBackupDirectory() {
  return join(systemContainerBackupBaseDirectory(), "Shared");
}

std::string QRVPerUserConfiguration::oldLoggingPath() const { return join(userHomeDirectory_, "Library/Logs/Quorva"); }

bool QRVPerUserConfiguration::existsUserBaseDirectory() {
  return fileManager_->itemExistsAtURL(join(userHomeDirectory_, "Containers"));
}

std::optional<std::string> QRVPerUserConfiguration::containerDirectoryURLForContentClass(QRVContainerClass contentClass,
                                                                                      bool transient) {
  if (!QRVContainerClassIsPerUser(contentClass)) {
    QRVLogError("Invalid class for a per user container directory: {}", contentClass);
    return std::nullopt;
  }
  QRVRecursiveMutexLock lock(&monitor_);
  std::string url = join(transient ? transientDirectory() : userBaseDirectory(),
                         QRVContainerClassRelativeDirectory(contentClass));
  QRVError error;
  if (!fileManager_->createDirectoryAtURLWithOwner(url, true, 0755, userIdentity_->posixUID(), &error))
    QRVLogError("Failed to create container dir at \"{}\": {}", url, error.description());
  return url;
}

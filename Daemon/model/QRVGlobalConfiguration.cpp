#include "model/QRVGlobalConfiguration.h"

#include "base/QRVLog.h"
#include "fs/QRVDictionaryAdditions.h"

namespace {

std::string join(const std::string& a, const std::string& b) { return QRVPathByAppendingComponent(a, b); }

}  // namespace

QRVGlobalConfiguration::QRVGlobalConfiguration(std::string root, std::shared_ptr<QRVSystemInfo> systemInfo,
                                               std::shared_ptr<QRVAccounts> accounts,
                                               std::shared_ptr<QRVFileManager> fileManager)
    : root_(std::move(root)),
      homeDirectory_(pathUnderRoot("/private/var/root/")),
      systemInfo_(std::move(systemInfo)),
      fileManager_(std::move(fileManager)) {
  if (std::optional<QRVAccount> mobile = accounts->accountForName("mobile")) {
    mobileUID_ = mobile->uid;
    mobileGID_ = mobile->gid;
    QRVLogDebug("Current mobile user ID is {}, group ID is {}", mobileUID_, mobileGID_);
  } else {
    QRVLogError("Failed to get mobile uid. This is bad");
  }
}

std::string QRVGlobalConfiguration::pathUnderRoot(const std::string& path) const {
  std::string r = root_;
  while (r.size() > 1 && r.back() == '/') r.pop_back();
  return r == "/" ? path : r + path;
}

std::string QRVGlobalConfiguration::remembered(std::string* slot, const std::string& path, uid_t owner,
                                               uint32_t protectionClass, const char* failureMessage) {
  QRVRecursiveMutexLock lock(&monitor_);
  if (slot->empty()) *slot = path;
  QRVError error;
  if (!fileManager_->createDirectoryAtURL(*slot, true, 0755, owner, protectionClass, &error))
    QRVLogError("{} at \"{}\": {}", failureMessage, *slot, error.description());
  return *slot;
}

std::string QRVGlobalConfiguration::sharedContainersDirectory() {
  return remembered(&sharedContainersDirectory_, pathUnderRoot("/private/var/containers"), 0,
                    QRVFileManager::kLeaveProtectionClassAlone, "Failed to create shared container dir");
}

std::string QRVGlobalConfiguration::bundleDirectory() {
  QRVRecursiveMutexLock lock(&monitor_);
  return remembered(&bundleDirectory_, join(sharedContainersDirectory(), "Bundle"), 0,
                    QRVFileManager::kLeaveProtectionClassAlone, "Failed to create bundle dir");
}

std::string QRVGlobalConfiguration::transientBundleDirectory() {
  QRVRecursiveMutexLock lock(&monitor_);
  return remembered(&transientBundleDirectory_, join(sharedContainersDirectory(), "Temp"), CONTAINER_INSTALLATION_UID,
                    QRVFileManager::kLeaveProtectionClassAlone, "Failed to create transient bundle dir");
}

std::string QRVGlobalConfiguration::libraryDirectory() {
  return remembered(&libraryDirectory_, join(homeDirectory_, "Library/Quorva"), 0, kDaemonDirectoryProtectionClass,
                    "Failed to create library dir");
}

std::string QRVGlobalConfiguration::cachesDirectory() {
  return remembered(&cachesDirectory_, join(homeDirectory_, "Library/Caches/com.kelva.quorvad"), 0,
                    kDaemonDirectoryProtectionClass, "Failed to create cache dir");
}

std::string QRVGlobalConfiguration::logDirectory() {
  // Not remembered: the log is opened once, and migrations move it.
  std::string path = join(homeDirectory_, "Library/Logs/Quorva");
  QRVError error;
  if (!fileManager_->createDirectoryAtURLWithClass(path, true, 0755, kDaemonDirectoryProtectionClass, &error))
    QRVLogError("Failed to create log directory at \"{}\": {}", path, error.description());
  return path;
}

std::string QRVGlobalConfiguration::pendingUpdatesDirectory() {
  QRVRecursiveMutexLock lock(&monitor_);
  return remembered(&pendingUpdatesDirectory_, join(libraryDirectory(), "PendingUpdates"), 0,
                    QRVFileManager::kLeaveProtectionClassAlone, "Failed to create updates dir");
}

std::string QRVGlobalConfiguration::replaceDirectory() {
  QRVRecursiveMutexLock lock(&monitor_);
  return remembered(&replaceDirectory_, join(libraryDirectory(), "Replace"), 0,
                    QRVFileManager::kLeaveProtectionClassAlone, "Failed to create replace dir");
}

std::string QRVGlobalConfiguration::deathrowDirectory() {
  QRVRecursiveMutexLock lock(&monitor_);
  return remembered(&deathrowDirectory_, join(cachesDirectory(), "Dead"), 0,
                    QRVFileManager::kLeaveProtectionClassAlone, "Failed to create deathrow dir");
}

std::string QRVGlobalConfiguration::stagingDirectory() {
  QRVRecursiveMutexLock lock(&monitor_);
  return remembered(&stagingDirectory_, join(cachesDirectory(), "Staging"), 0,
                    QRVFileManager::kLeaveProtectionClassAlone, "Failed to create staging dir");
}

std::string QRVGlobalConfiguration::transientDirectory() {
  QRVRecursiveMutexLock lock(&monitor_);
  return remembered(&transientDirectory_, join(cachesDirectory(), "Temp"), 0,
                    QRVFileManager::kLeaveProtectionClassAlone, "Failed to create transient dir");
}

std::string QRVGlobalConfiguration::legacyTransientBundleDirectory() const {
  return pathUnderRoot("/private/var/verdaned/Library/Caches/com.kelva.quorvad");
}

std::optional<std::string> QRVGlobalConfiguration::globalContainerBaseURLWithContentClass(
    QRVContainerClass contentClass, bool transient) {
  bool bundle = QRVContainerClassIsBundle(contentClass), system = QRVContainerClassIsSystem(contentClass);
  if (!bundle && !system) return std::nullopt;
  std::string parent = !transient ? sharedContainersDirectory()
                       : bundle   ? transientBundleDirectory()
                                  : transientDirectory();
  return join(parent, QRVContainerClassRelativeDirectory(contentClass));
}

std::optional<std::string> QRVGlobalConfiguration::containerDirectoryURLForUserIdentity(
    const QRVUserIdentityRef& userIdentity, QRVContainerClass contentClass, bool transient) {
  QRVRecursiveMutexLock lock(&monitor_);
  bool bundle = QRVContainerClassIsBundle(contentClass), system = QRVContainerClassIsSystem(contentClass);
  if (!bundle && !system) {
    if (!userIdentity) return std::nullopt;
    return getPerUserConfigurationForUserIdentity(userIdentity)->containerDirectoryURLForContentClass(contentClass,
                                                                                                      transient);
  }
  std::optional<std::string> url = globalContainerBaseURLWithContentClass(contentClass, transient);
  // Owner 0 leaves ownership alone: system trees stay root's.
  uid_t owner = bundle ? CONTAINER_INSTALLATION_UID : 0;
  QRVError error;
  if (!fileManager_->createDirectoryAtURLWithOwner(*url, true, 0755, owner, &error))
    QRVLogError("Failed to create container dir at \"{}\": {}", *url, error.description());
  return url;
}

std::string QRVGlobalConfiguration::stagingDirectoryURLForUserIdentity(const QRVUserIdentityRef& userIdentity,
                                                                       QRVContainerClass contentClass) {
  QRVRecursiveMutexLock lock(&monitor_);
  if (QRVContainerClassIsPerUser(contentClass) && userIdentity)
    return getPerUserConfigurationForUserIdentity(userIdentity)->stagingDirectory();
  return stagingDirectory();
}

std::shared_ptr<QRVPerUserConfiguration> QRVGlobalConfiguration::getPerUserConfigurationForUserIdentity(
    const QRVUserIdentityRef& userIdentity) {
  QRVRecursiveMutexLock lock(&monitor_);
  auto& slot = perUserConfigurations_[userIdentity->identifier()];
  if (!slot) slot = std::make_shared<QRVPerUserConfiguration>(userIdentity, fileManager_);
  return slot;
}

const std::vector<std::string>& QRVGlobalConfiguration::appUserDataItemNames() {
  static const std::vector<std::string> names = {"Documents", "Library", "tmp", "Coinvault"};
  return names;
}

const std::vector<std::string>& QRVGlobalConfiguration::excludedFromAppUserData() {
  static const std::vector<std::string> names = {"SystemData"};
  return names;
}

bool QRVGlobalConfiguration::migrationFileExistsWithName(const std::string& name) {
  return fileManager_->itemExistsAtURL(join(libraryDirectory(), name));
}

bool QRVGlobalConfiguration::isInternalImage() {
  std::call_once(internalOnce_, [this] {
    bool internal = systemInfo_->isInternalBuild();
    QRVMutexLock lock(&internalMutex_);
    isInternalImage_ = internal;
  });
  QRVMutexLock lock(&internalMutex_);
  return isInternalImage_;
}

void QRVGlobalConfiguration::setIsInternalImage(bool internal) {
  // The override holds from now on: the first query must not replace it.
  std::call_once(internalOnce_, [] {});
  QRVMutexLock lock(&internalMutex_);
  isInternalImage_ = internal;
}

#include "QRVGlobalConfiguration.h"

#include "QRVLog.h"

QRVGlobalConfiguration::QRVGlobalConfiguration(std::string root, std::shared_ptr<QRVSystemInfo> systemInfo,
                                               std::shared_ptr<QRVAccounts> accounts,
                                               std::shared_ptr<QRVFileManager> fileManager)
    : root_(std::move(root)), systemInfo_(std::move(systemInfo)), fileManager_(std::move(fileManager)) {
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

std::string QRVGlobalConfiguration::homeDirectory() const { return pathUnderRoot("/private/var/root/"); }

std::string QRVGlobalConfiguration::logDirectory() {
  std::string path = homeDirectory() + "Library/Logs/Quorva";
  QRVError error;
  if (!fileManager_->createDirectoryAtURL(path, true, 0755, &error))
    QRVLogError("Failed to create log directory at \"{}\": {}", path, error.description());
  return path;
}

bool QRVGlobalConfiguration::isInternalImage() {
  {
    std::lock_guard<std::mutex> lock(mutex_);
    if (internalOverride_ >= 0) return internalOverride_ == 1;
  }
  return systemInfo_->isInternalBuild();
}

void QRVGlobalConfiguration::setIsInternalImage(bool internal) {
  std::lock_guard<std::mutex> lock(mutex_);
  internalOverride_ = internal ? 1 : 0;
}

// The daemon-wide configuration: the root every path lives under, and the
// daemon's own directories.
//
// Directory accessors create their directory on every access and return the
// path even when creation fails, logging the failure: the caller's own use of
// the path then reports the real problem.
#pragma once

#include <memory>
#include <mutex>
#include <string>

#include "QRVAccounts.h"
#include "QRVFileManager.h"
#include "QRVSystemInfo.h"

class QRVGlobalConfiguration {
 public:
  // Looks up the account "mobile"; without it both ids stay 0.
  QRVGlobalConfiguration(std::string root, std::shared_ptr<QRVSystemInfo> systemInfo,
                         std::shared_ptr<QRVAccounts> accounts, std::shared_ptr<QRVFileManager> fileManager);

  const std::string& root() const { return root_; }
  // `path` (absolute, as on a device) under the root.
  std::string pathUnderRoot(const std::string& path) const;

  // The daemon's home: "/private/var/root/" under the root.
  std::string homeDirectory() const;
  // HOME + "Library/Logs/Quorva", mode 0755.
  std::string logDirectory();

  uid_t currentMobileUserId() const { return mobileUID_; }
  gid_t currentMobileGroupId() const { return mobileGID_; }

  bool isInternalImage();
  // Overrides what the build variant says (tests).
  void setIsInternalImage(bool internal);

 private:
  const std::string root_;
  const std::shared_ptr<QRVSystemInfo> systemInfo_;
  const std::shared_ptr<QRVFileManager> fileManager_;
  uid_t mobileUID_ = 0;
  gid_t mobileGID_ = 0;
  std::mutex mutex_;
  int internalOverride_ = -1;  // GUARDED_BY(mutex_): -1 none, else 0/1
};

// Where everything lives. The device-wide trees (bundle and system
// containers, the daemon's library, caches and logs) come from here; the
// trees inside a user's home come from that user's QRVPerUserConfiguration,
// which this object hands out. The mapping from class, user identity and
// transient flag to a directory lives here and nowhere else.
//
// Every directory accessor creates its directory on every access (a tree
// removed behind the daemon's back comes back) and returns the path even
// when creation fails, logging the failure: the caller's own use of the path
// then reports the real problem.
//
// Thread-safe. Lock order: this object's monitor before any per-user
// configuration's.
#pragma once

#include <sys/types.h>

#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "base/QRVMutex.h"
#include "base/QRVRecursiveMutex.h"
#include "fs/QRVFileManager.h"
#include "model/QRVContainerClass.h"
#include "model/QRVPerUserConfiguration.h"
#include "model/QRVUserIdentity.h"
#include "platform/QRVAccounts.h"
#include "platform/QRVSystemInfo.h"

class QRVGlobalConfiguration {
 public:
  // Data-protection class of the daemon's own library, caches and logs.
  static constexpr uint32_t kDaemonDirectoryProtectionClass = 4;

  // Looks up the account "mobile"; without it both ids stay 0.
  QRVGlobalConfiguration(std::string root, std::shared_ptr<QRVSystemInfo> systemInfo,
                         std::shared_ptr<QRVAccounts> accounts, std::shared_ptr<QRVFileManager> fileManager);

  const std::string& root() const { return root_; }
  // `path` (absolute, as on a device) under the root.
  std::string pathUnderRoot(const std::string& path) const;

  // "/private/var/root/" under the root.
  const std::string& homeDirectory() const { return homeDirectory_; }

  std::string sharedContainersDirectory();  // /private/var/containers
  std::string bundleDirectory();            // shared + Bundle
  std::string transientBundleDirectory();   // shared + Temp, owned by the installer
  std::string libraryDirectory();           // HOME + Library/Quorva, class 4
  std::string cachesDirectory();            // HOME + Library/Caches/com.kelva.quorvad, class 4
  std::string logDirectory();               // HOME + Library/Logs/Quorva, class 4, not remembered
  std::string pendingUpdatesDirectory();    // library + PendingUpdates
  std::string replaceDirectory();           // library + Replace
  std::string deathrowDirectory();          // caches + Dead
  std::string stagingDirectory();           // caches + Staging
  std::string transientDirectory();         // caches + Temp
  // Where an older system kept transient bundles; never created.
  std::string legacyTransientBundleDirectory() const;

  // The directory holding containers of `contentClass` for `userIdentity`
  // (created), or nothing for an invalid class.
  std::optional<std::string> containerDirectoryURLForUserIdentity(const QRVUserIdentityRef& userIdentity,
                                                                  QRVContainerClass contentClass, bool transient);
  // The device-wide directory of a bundle or system class (not created);
  // nothing for any other class.
  std::optional<std::string> globalContainerBaseURLWithContentClass(QRVContainerClass contentClass, bool transient);
  // Where new containers of a class are built: the user's staging directory
  // for per-user classes, the global one otherwise.
  std::string stagingDirectoryURLForUserIdentity(const QRVUserIdentityRef& userIdentity,
                                                 QRVContainerClass contentClass);
  // The user's configuration, made on first request and kept.
  std::shared_ptr<QRVPerUserConfiguration> getPerUserConfigurationForUserIdentity(
      const QRVUserIdentityRef& userIdentity);

  // The top-level items of an application data container that are the
  // user's data, and those that never are.
  static const std::vector<std::string>& appUserDataItemNames();
  static const std::vector<std::string>& excludedFromAppUserData();
  // Whether library + `name` exists.
  bool migrationFileExistsWithName(const std::string& name);

  uid_t currentMobileUserId() const { return mobileUID_; }
  gid_t currentMobileGroupId() const { return mobileGID_; }

  // How many older log files the log writer keeps, and the size at which it
  // starts a new one: more on an internal image, for diagnosis.
  long logRotationCount() { return isInternalImage() ? 4 : 1; }
  size_t logSizeLimit() { return isInternalImage() ? 262'144 : 102'400; }

  // Asked of the build variant once; `setIsInternalImage` overrides it.
  bool isInternalImage();
  void setIsInternalImage(bool internal);

 private:
  // Computes `*slot` once from `path`, then creates it on every call.
  std::string remembered(std::string* slot, const std::string& path, uid_t owner, uint32_t protectionClass,
                         const char* failureMessage);

  const std::string root_;
  const std::string homeDirectory_;
  const std::shared_ptr<QRVSystemInfo> systemInfo_;
  const std::shared_ptr<QRVFileManager> fileManager_;
  uid_t mobileUID_ = 0;
  gid_t mobileGID_ = 0;

  QRVRecursiveMutex monitor_;
  std::string sharedContainersDirectory_ GUARDED_BY(monitor_);
  std::string bundleDirectory_ GUARDED_BY(monitor_);
  std::string transientBundleDirectory_ GUARDED_BY(monitor_);
  std::string libraryDirectory_ GUARDED_BY(monitor_);
  std::string cachesDirectory_ GUARDED_BY(monitor_);
  std::string pendingUpdatesDirectory_ GUARDED_BY(monitor_);
  std::string replaceDirectory_ GUARDED_BY(monitor_);
  std::string deathrowDirectory_ GUARDED_BY(monitor_);
  std::string stagingDirectory_ GUARDED_BY(monitor_);
  std::string transientDirectory_ GUARDED_BY(monitor_);
  std::map<std::string, std::shared_ptr<QRVPerUserConfiguration>> perUserConfigurations_ GUARDED_BY(monitor_);

  std::once_flag internalOnce_;
  QRVMutex internalMutex_;
  bool isInternalImage_ GUARDED_BY(internalMutex_) = false;
};

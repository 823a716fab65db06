// The directories inside one user's home: its container trees, staging and
// transient directories, its library and the backups of system containers.
// Made and kept by QRVGlobalConfiguration, one per user identity.
//
// Thread-safe; its monitor is taken after the global configuration's.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "base/QRVRecursiveMutex.h"
#include "fs/QRVFileManager.h"
#include "model/QRVContainerClass.h"
#include "model/QRVUserIdentity.h"

class QRVPerUserConfiguration {
 public:
  QRVPerUserConfiguration(QRVUserIdentityRef userIdentity, std::shared_ptr<QRVFileManager> fileManager);

  const QRVUserIdentityRef& userIdentity() const { return userIdentity_; }
  const std::string& userHomeDirectory() const { return userHomeDirectory_; }

  std::string userBaseDirectory();   // USERHOME + Containers
  std::string stagingDirectory();    // user base + Staging
  std::string transientDirectory();  // user base + Temp
  std::string libraryDirectory();    // USERHOME + Library/Quorva
  // Not created.
  std::string systemContainerBackupBaseDirectory();   // USERHOME + Library/Backup/SystemContainers
  std::string systemContainerBackupDirectory();       // backup base + Data
  std::string systemGroupContainerBackupDirectory();  // backup base + Shared
  std::string oldLoggingPath() const;                 // USERHOME + Library/Logs/Quorva

  // Whether USERHOME + Containers exists (without creating it).
  bool existsUserBaseDirectory();
  // The directory of a per-user class (created, owned by the user); nothing
  // (and a log line) for any other class.
  std::optional<std::string> containerDirectoryURLForContentClass(QRVContainerClass contentClass, bool transient);

 private:
  std::string remembered(std::string* slot, const std::string& path, const char* failureMessage);

  const QRVUserIdentityRef userIdentity_;
  const std::shared_ptr<QRVFileManager> fileManager_;
  const std::string userHomeDirectory_;

  QRVRecursiveMutex monitor_;
  std::string userBaseDirectory_ GUARDED_BY(monitor_);
  std::string stagingDirectory_ GUARDED_BY(monitor_);
  std::string transientDirectory_ GUARDED_BY(monitor_);
  std::string libraryDirectory_ GUARDED_BY(monitor_);
};

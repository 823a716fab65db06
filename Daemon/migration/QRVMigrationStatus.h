// Which one-time migrations have run, and on which build: so that layout
// migrations run once per upgrade and never again.
//
// Two status files, binary property lists: "qrv_migration_status.plist" in
// the global library directory (system migrations) and
// "qrv_user_migration_status.plist" in the default user's library directory.
// Each holds "LastBuildInfo" (the system-version dictionary when last saved)
// and one dictionary per completed migration type. Older releases kept one
// marker file per migration; the system status folds them in the first time
// it finds its file empty.
//
// Not thread-safe: one object per use, on one thread.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "base/QRVPlist.h"

struct QRVServices;

class QRVMigrationStatus {
 public:
  // Migration types.
  static constexpr const char* kBundleMigration = "BundleMigration";
  static constexpr const char* kACLMigration = "ACLMigration";
  static constexpr const char* kGroupIdMigration = "GroupIdMigration";
  static constexpr const char* kCodeSigningMigration = "CodeSigningMigration";
  static constexpr const char* kSubdirectoryMigration = "SubdirectoryMigration";

  // Null when the status file exists but cannot be read (logged): callers
  // then run nothing that depends on it.
  static std::unique_ptr<QRVMigrationStatus> initForSystemMigration(QRVServices& services);
  static std::unique_ptr<QRVMigrationStatus> initForMobileUserMigration(QRVServices& services);

  // Whether this boot is the first on a new build; true whenever it cannot
  // tell.
  bool isBuildUpgrade();
  bool writeCurrentBuildInfoToDisk();
  bool setMigrationCompleteForType(const std::string& type);
  bool hasMigrationOccurredForType(const std::string& type) const;

  // The OS build version, read once; "Unknown" when it cannot be read.
  static std::string currentBuildVersion(QRVServices& services);

  const QRVPlist& migrationInfo() const { return migrationInfo_; }

 private:
  QRVMigrationStatus(QRVServices& services, std::string path);

  // The system-version dictionary now, with "ReleaseType" added from the
  // release file's variant; none when the platform has no dictionary.
  QRVPlist currentBuildInfo();
  // False (logged) when the file exists but cannot be read or is not a
  // dictionary; a missing file reads as an empty dictionary.
  bool _readMigrationStatusFromDisk();
  bool _writeMigrationStatusToDisk();
  // Folds the marker files of older releases into the status file; they are
  // removed only once the status file holding them has been written.
  void _migrateFromManyMarkerFilesToOne();
  void _readStatusFromMarkerFileWithName(const std::string& name, const std::string& type);
  void _removeMarkerFileWithName(const std::string& name);

  QRVServices& services_;
  const std::string path_;
  QRVPlist migrationInfo_;
};

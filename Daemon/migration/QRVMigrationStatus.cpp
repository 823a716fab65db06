#include "migration/QRVMigrationStatus.h"

#include <cerrno>
#include <chrono>
#include <ctime>
#include <vector>

#include "base/QRVError.h"
#include "base/QRVLog.h"
#include "core/QRVServices.h"
#include "fs/QRVDictionaryAdditions.h"
#include "model/QRVPerUserConfiguration.h"

namespace {

constexpr const char* kSystemStatusFileName = "qrv_migration_status.plist";
constexpr const char* kUserStatusFileName = "qrv_user_migration_status.plist";
constexpr const char* kLastBuildInfoKey = "LastBuildInfo";
constexpr const char* kReleaseTypeKey = "ReleaseType";
// os-release names the build and the variant; "LastBuildInfo" keeps the
// release file's keys as they are and adds "ReleaseType" for the variant.
constexpr const char* kBuildVersionKey = "BUILD_ID";
constexpr const char* kVariantKey = "VARIANT_ID";
constexpr const char* kVersionNumberKey = "QRVMigrationVersionNumber";
constexpr const char* kTimeKey = "QRVMigrationTime";
// The status and marker files are a few hundred bytes; anything far larger
// is not ours and is refused rather than read into memory.
constexpr size_t kMaxStatusFileLength = 4 * 1024 * 1024;

// The per-migration marker files of older releases, in the order they are
// folded into the status file.
struct Marker {
  const char* fileName;
  const char* type;
};
constexpr Marker kMarkers[] = {
    {"qrv_bundle_migration_complete.plist", QRVMigrationStatus::kBundleMigration},
    {"qrv_acl2_migration_complete.plist", QRVMigrationStatus::kACLMigration},
    {"qrv_group_id_migration_complete.plist", QRVMigrationStatus::kGroupIdMigration},
    {"qrv_code_signing_migration_complete.plist", QRVMigrationStatus::kCodeSigningMigration},
};

bool isMissingFile(const QRVError& error) { return error.isPOSIX() && error.code() == ENOENT; }

// A value that may be absent, rendered the way a log line shows nothing.
std::string orNull(const std::string& value) { return value.empty() ? "(null)" : value; }

// Now, as a date describes itself: "2024-05-01 12:00:00 +0000".
std::string nowDescription() {
  std::time_t now = std::chrono::system_clock::to_time_t(std::chrono::system_clock::now());
  std::tm utc{};
  gmtime_r(&now, &utc);
  char text[64];
  std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S +0000", &utc);
  return text;
}

// Reads a property-list dictionary from one of the daemon's own files. A link
// or anything but a regular file in its place is refused, not followed.
std::optional<QRVPlist> readDictionary(QRVFileManager& fileManager, const std::string& path, QRVError* error) {
  std::vector<uint8_t> bytes;
  if (!fileManager.readRegularFileAtURL(path, kMaxStatusFileLength, &bytes, error)) return std::nullopt;
  std::optional<QRVPlist> plist = QRVPlist::fromBytes(bytes.data(), bytes.size());
  if (!plist || !plist->isDictionary()) {
    QRVFail(error, QRVError::make(QRVError::kGeneralDomain, 2048, __func__, __LINE__, -1,
                                  fmt::format("The file {} is not a property-list dictionary", path)));
    return std::nullopt;
  }
  return plist;
}

}  // namespace

QRVMigrationStatus::QRVMigrationStatus(QRVServices& services, std::string path)
    : services_(services), path_(std::move(path)) {}

std::unique_ptr<QRVMigrationStatus> QRVMigrationStatus::initForSystemMigration(QRVServices& services) {
  std::string path =
      QRVPathByAppendingComponent(services.globalConfiguration->libraryDirectory(), kSystemStatusFileName);
  std::unique_ptr<QRVMigrationStatus> status(new QRVMigrationStatus(services, std::move(path)));
  if (!status->_readMigrationStatusFromDisk()) {
    QRVLogError("Error reading system migration file from disk.  This is bad");
    return nullptr;
  }
  if (status->migrationInfo_.dictionaryValue().empty()) status->_migrateFromManyMarkerFilesToOne();
  return status;
}

std::unique_ptr<QRVMigrationStatus> QRVMigrationStatus::initForMobileUserMigration(QRVServices& services) {
  QRVUserIdentityRef user = services.userIdentityCache->defaultUserIdentity();
  std::string library = services.globalConfiguration->getPerUserConfigurationForUserIdentity(user)->libraryDirectory();
  std::string path = QRVPathByAppendingComponent(library, kUserStatusFileName);
  std::unique_ptr<QRVMigrationStatus> status(new QRVMigrationStatus(services, std::move(path)));
  if (!status->_readMigrationStatusFromDisk()) {
    QRVLogError("Error reading user migration file from disk.  This is bad");
    return nullptr;
  }
  return status;
}

std::string QRVMigrationStatus::currentBuildVersion(QRVServices& services) {
  // The system-info service reads the release file once and keeps it.
  std::string build = services.platform.systemInfo ? services.platform.systemInfo->buildVersion() : std::string();
  return build.empty() ? "Unknown" : build;
}

bool QRVMigrationStatus::isBuildUpgrade() {
  const QRVPlist* last = migrationInfo_.get(kLastBuildInfoKey);
  if (!last || !last->isDictionary()) {
    QRVLogNotice("Did not find last build info; we must be upgrading from pre-9.3.1 or this is an erase install.");
    return true;
  }
  const std::string& lastVersion = last->stringForKey(kBuildVersionKey);
  if (lastVersion.empty()) {
    QRVLogNotice("Could not get build version from last build info dictionary; assuming this is an upgrade");
    return true;
  }
  QRVPlist current = currentBuildInfo();
  if (!current.isDictionary() || current.dictionaryValue().empty()) {
    QRVLogNotice("Could not get current build info; assuming this is an upgrade");
    return true;
  }
  const std::string& currentVersion = current.stringForKey(kBuildVersionKey);
  if (currentVersion.empty()) {
    QRVLogNotice("Could not get current build string; assuming this is an upgrade");
    return true;
  }
  std::string lastType = orNull(last->stringForKey(kReleaseTypeKey));
  std::string currentType = orNull(current.stringForKey(kReleaseTypeKey));
  // Only the build decides: a variant change on the same build is no upgrade.
  if (currentVersion == lastVersion) {
    QRVLogNotice("Current build version ({} / {}) equal to last version recorded ({} / {}); skipping upgrade",
                 currentVersion, currentType, lastVersion, lastType);
    return false;
  }
  QRVLogNotice("Detected upgrade from {} ({}) to {} ({})", lastVersion, lastType, currentVersion, currentType);
  return true;
}

bool QRVMigrationStatus::writeCurrentBuildInfoToDisk() {
  QRVPlist current = currentBuildInfo();
  std::string version = current.stringForKey(kBuildVersionKey);
  migrationInfo_.set(kLastBuildInfoKey, std::move(current));
  if (!_writeMigrationStatusToDisk()) return false;
  QRVLogNotice("Saved last build version of {}", orNull(version));
  return true;
}

bool QRVMigrationStatus::setMigrationCompleteForType(const std::string& type) {
  std::string version = currentBuildVersion(services_);
  migrationInfo_.set(type, QRVPlist::dictionary()
                               .set(kVersionNumberKey, QRVPlist::string(version))
                               .set(kTimeKey, QRVPlist::string(nowDescription())));
  if (!_writeMigrationStatusToDisk()) return false;
  QRVLogNotice("Migration completed on {} for {}", version, type);
  return true;
}

bool QRVMigrationStatus::hasMigrationOccurredForType(const std::string& type) const {
  return migrationInfo_.get(type) != nullptr;
}

QRVPlist QRVMigrationStatus::currentBuildInfo() {
  QRVPlist info = services_.platform.systemInfo ? services_.platform.systemInfo->systemVersion() : QRVPlist();
  if (!info.isDictionary()) return QRVPlist();
  const std::string variant = info.stringForKey(kVariantKey);
  if (!variant.empty()) info.set(kReleaseTypeKey, QRVPlist::string(variant));
  return info;
}

bool QRVMigrationStatus::_readMigrationStatusFromDisk() {
  QRVError error;
  std::optional<QRVPlist> info = readDictionary(*services_.fileManager, path_, &error);
  if (info) {
    migrationInfo_ = std::move(*info);
    return true;
  }
  if (isMissingFile(error)) {
    migrationInfo_ = QRVPlist::dictionary();
    return true;
  }
  QRVLogError("Failed to read migration status file at {} : {}", path_, error.description());
  return false;
}

bool QRVMigrationStatus::_writeMigrationStatusToDisk() {
  // Written without a data-protection class of its own, so that boot-time
  // migrations can read it while the device is still locked.
  QRVError error;
  if (QRV_writeToURL(*services_.fileManager, migrationInfo_, path_, &error)) return true;
  QRVLogError("Failed to write migration status on {} for {} : {}", path_, migrationInfo_.description(),
              error.description());
  return false;
}

void QRVMigrationStatus::_migrateFromManyMarkerFilesToOne() {
  QRVLogNotice("Migrating from many marker files down to one");
  for (const Marker& marker : kMarkers) _readStatusFromMarkerFileWithName(marker.fileName, marker.type);
  // The markers are the only record of those migrations until the status
  // file holding them is safely on disk.
  if (!_writeMigrationStatusToDisk()) return;
  for (const Marker& marker : kMarkers) _removeMarkerFileWithName(marker.fileName);
}

void QRVMigrationStatus::_readStatusFromMarkerFileWithName(const std::string& name, const std::string& type) {
  std::string path = QRVPathByAppendingComponent(services_.globalConfiguration->libraryDirectory(), name);
  QRVError error;
  std::optional<QRVPlist> marker = readDictionary(*services_.fileManager, path, &error);
  if (marker) {
    migrationInfo_.set(type, std::move(*marker));
  } else if (!isMissingFile(error)) {
    QRVLogError("Failed to read migration marker file at {} : {}", path, error.description());
  }
}

void QRVMigrationStatus::_removeMarkerFileWithName(const std::string& name) {
  std::string path = QRVPathByAppendingComponent(services_.globalConfiguration->libraryDirectory(), name);
  QRVError error;
  if (!services_.fileManager->removeFileAtURL(path, &error))
    QRVLogError("Failed to remove marker file at {}: {}", path, error.description());
}

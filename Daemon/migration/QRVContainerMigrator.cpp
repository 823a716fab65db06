#include "migration/QRVContainerMigrator.h"

#include <cerrno>
#include <charconv>

#include "base/QRVLog.h"
#include "codesigning/QRVCodeSigningMapping.h"
#include "core/QRVCrashPoints.h"
#include "core/QRVExceptionReporter.h"
#include "core/QRVServices.h"
#include "dataprotection/QRVDataProtectionManager.h"
#include "fs/QRVPathComponents.h"
#include "migration/QRVMigrationStatus.h"
#include "model/QRVPerUserConfiguration.h"
#include "operations/QRVClientConnection.h"

namespace {

bool isMissing(const QRVError& error) { return error.isPOSIX() && error.code() == ENOENT; }

bool isMultiUserHost(QRVServices& services) {
  return services.platform.personas && services.platform.personas->isMultiUserHost();
}

// The old log files were numbered by their extension: "quorvad.log.2" is
// number 2. A name without a numeric extension ("quorvad.log") is the
// current file, number 0.
struct OldLogName {
  std::string stem;  // the name without its extension
  long number = 0;
};

OldLogName parseOldLogName(const std::string& name) {
  OldLogName parsed{name};
  const size_t dot = name.find_last_of('.');
  if (dot == std::string::npos || dot == 0) return parsed;
  parsed.stem = name.substr(0, dot);
  const char* begin = name.data() + dot + 1;
  const char* end = name.data() + name.size();
  long number = 0;
  auto [rest, failure] = std::from_chars(begin, end, number);
  if (failure == std::errc() && rest == end && number >= 0) parsed.number = number;
  return parsed;
}

// The home directories are the users' own: a link in one of them could
// point the daemon, which moves and removes as root, at anything. A path
// below `base` is used only when it names itself, every component a real
// directory entry rather than a link.
bool namesItself(QRVFileManager& fileManager, const std::string& path, const std::string& base) {
  std::optional<std::string> realBase = fileManager.realPathForURL(base, base);
  std::optional<std::string> realPath = fileManager.realPathForURL(path, base);
  return realBase && realPath && path.compare(0, base.size(), base) == 0 &&
         *realPath == *realBase + path.substr(base.size());
}

}  // namespace

QRVContainerMigrator::QRVContainerMigrator(std::weak_ptr<QRVServices> services) : services_(std::move(services)) {}

std::shared_ptr<QRVServices> QRVContainerMigrator::_services(QRVError* error) const {
  std::shared_ptr<QRVServices> services = services_.lock();
  if (!services) QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput, "The daemon is shutting down"));
  return services;
}

// ---- Build upgrade ----

bool QRVContainerMigrator::performSynchronousBuildUpgradeMigration(QRVMigrationStatus& status, QRVError* error) {
  std::shared_ptr<QRVServices> services = _services(error);
  if (!services) return false;
  // A multi-user host never wrote logs into a user's home.
  if (!isMultiUserHost(*services)) _migrateLogFiles(*services);
  if (!_relocateBundleContainers(*services, error)) return false;
  _checkIfDeviceMayNeedSystemContainerACLMigration(*services, status);
  QRVError whitelistError;
  if (!_performWhitelistMigrationWithError(&whitelistError)) {
    QRVLogError("Failed to migrate whitelisted bundle containers : {}", whitelistError.description());
    return QRVFail(error, whitelistError);
  }
  return true;
}

// Older releases wrote their log into the mobile user's home. The newest
// files are kept, as many as the log writer keeps itself, each one number
// older than it was (the current file becomes number 1); the rest go with the
// old directory.
void QRVContainerMigrator::_migrateLogFiles(QRVServices& services) {
  QRVFileManager& fileManager = *services.fileManager;
  QRVGlobalConfiguration& config = *services.globalConfiguration;
  std::shared_ptr<QRVPerUserConfiguration> perUser =
      config.getPerUserConfigurationForUserIdentity(services.userIdentityCache->defaultUserIdentity());
  const std::string oldDirectory = perUser->oldLoggingPath();
  if (fileManager.itemDoesNotExistAtURL(oldDirectory)) return;
  if (!namesItself(fileManager, oldDirectory, perUser->userHomeDirectory())) {
    QRVLogError("Not migrating log files from {}: the path passes through a link", oldDirectory);
    return;
  }

  QRVError error;
  std::optional<std::vector<std::string>> items = fileManager.urlsForItemsInDirectoryAtURL(oldDirectory, &error);
  if (!items && !isMissing(error))
    QRVLogError("Failed to get items for deletion: {} : {}", oldDirectory, error.description());
  if (items) {
    const long rotationCount = config.logRotationCount();
    const std::string logDirectory = config.logDirectory();
    for (const std::string& item : *items) {
      OldLogName old = parseOldLogName(QRVPathComponents::last(item));
      const long number = old.number + 1;
      if (number > rotationCount) continue;
      const std::string destination =
          QRVPathComponents::appending(logDirectory, old.stem + "." + std::to_string(number));
      QRVError moveError;
      if (!fileManager.moveItemAtURL(item, destination, &moveError))
        QRVLogError("Failed to move to new logging directory from {} : {}", item, moveError.description());
      QRVCrashPoint(services, "migration.log-moved");
    }
  }
  QRVLogNotice("Migrated log files on {}", QRVMigrationStatus::currentBuildVersion(services));
  if (!fileManager.removeItemAtURL(oldDirectory, &error))
    QRVLogError("Failed to remove old Log directory: {}", error.description());
}

// A device of a much older layout kept its bundle containers in the mobile
// user's home, owned by that user (the ownership migration of the data
// migrator hands them to the installer). The tree moves whole, in one
// rename, onto the global bundle directory; what the daemon made there
// meanwhile is only empty directories, which make way. A path that passes
// through a link is not followed: the daemon would be moving whatever the
// link names.
bool QRVContainerMigrator::_relocateBundleContainers(QRVServices& services, QRVError* error) {
  QRVFileManager& fileManager = *services.fileManager;
  QRVGlobalConfiguration& config = *services.globalConfiguration;
  const std::string oldBundles = config.pathUnderRoot(kOldBundleContainersPath);
  if (!fileManager.directoryExistsAtURL(oldBundles)) return true;
  const std::string home = QRVPathComponents::deletingLast(QRVPathComponents::deletingLast(oldBundles));
  if (!namesItself(fileManager, oldBundles, home)) {
    QRVLogError("Not moving bundle containers from {}: the path passes through a link", oldBundles);
    return true;
  }

  QRVLogNotice("Moving bundle containers from user to system location");
  const std::string bundles = config.bundleDirectory();
  fileManager.removeEmptyDirectoryTreeAtURL(bundles, nullptr);
  QRVError moveError;
  if (!fileManager.moveItemAtURL(oldBundles, bundles, &moveError)) {
    QRVLogError("Failed to migrate to new bundle containers location : {}.  This is terrible.",
                moveError.description());
    // The accessor makes the directory again for everyone else.
    config.bundleDirectory();
    return QRVFail(error, moveError);
  }
  QRVCrashPoint(services, "migration.bundles-relocated");
  return true;
}

void QRVContainerMigrator::_checkIfDeviceMayNeedSystemContainerACLMigration(QRVServices& services,
                                                                            QRVMigrationStatus& status) {
  if (status.hasMigrationOccurredForType(QRVMigrationStatus::kACLMigration)) return;
  QRVGlobalConfiguration& config = *services.globalConfiguration;
  for (QRVContainerClass systemClass : {QRVContainerClassSystemData, QRVContainerClassSystemGroup}) {
    std::optional<std::string> base = config.globalContainerBaseURLWithContentClass(systemClass, false);
    if (base && !services.fileManager->itemDoesNotExistAtURL(*base)) return;
  }
  QRVLogNotice("No system containers requiring ACL migration");
  status.setMigrationCompleteForType(QRVMigrationStatus::kACLMigration);
}

// The well-known system containers have lived under the shared containers
// directory, in the class directories they have now, for as long as this
// layout has existed: no older location of them is known, so there is
// nothing to bring over. This is the place for it when a layout change
// moves them.
bool QRVContainerMigrator::_performWhitelistMigrationWithError(QRVError*) { return true; }

// ---- Data migrator ----

bool QRVContainerMigrator::performDataMigratorMigrationForClientConnection(QRVClientConnection& connection,
                                                                          QRVError* error) {
  std::shared_ptr<QRVServices> services = _services(error);
  if (!services) return false;
  return QRVGuarded(services->globalConfiguration->isInternalImage(), error, false, [&] {
    _performDataMigratorSteps(*services, connection);
    return true;
  });
}

void QRVContainerMigrator::_performDataMigratorSteps(QRVServices& services, QRVClientConnection& connection) {
  QRVLogNotice("Performing data migrator migration on {}", QRVMigrationStatus::currentBuildVersion(services));
  QRVError stepError;
  if (!_performInternalACLMigrationWithError(services, &stepError))
    QRVLogError("Failed to migrate system container ACLs : {}", stepError.description());
  if (!_performBundleContainerOwnershipMigrationWithError(services, &stepError))
    QRVLogError("Failed to migrate bundle container ownership : {}", stepError.description());
  if (services.codeSigningMapping)
    services.codeSigningMapping->performAllCodeSigningMigrationAndReconciliationWithCommandQueue(
        connection.commandQueue());
}

bool QRVContainerMigrator::_performInternalACLMigrationWithError(QRVServices& services, QRVError* error) {
  std::unique_ptr<QRVMigrationStatus> status = QRVMigrationStatus::initForSystemMigration(services);
  if (!status)
    return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput, "The migration status cannot be read"));
  if (status->hasMigrationOccurredForType(QRVMigrationStatus::kACLMigration)) return true;

  struct Half {
    QRVContainerClass containerClass;
    const char* failure;
  };
  const Half halves[] = {{QRVContainerClassSystemData, "Failed to set ACLs on system containers : {}"},
                         {QRVContainerClassSystemGroup, "Failed to set ACLs on system group containers : {}"}};
  bool failed = false;
  for (const Half& half : halves) {
    // Looked at without being made: a device without system containers
    // has nothing to fix.
    std::optional<std::string> directory =
        services.globalConfiguration->globalContainerBaseURLWithContentClass(half.containerClass, false);
    if (!directory || !services.fileManager->directoryExistsAtURL(*directory)) continue;
    QRVError halfError;
    if (!services.fileManager->standardizeAllSystemContainerACLsAtURL(*directory, &halfError)) {
      QRVLogError(fmt::runtime(half.failure), halfError.description());
      failed = true;
      if (error) *error = halfError;
    }
    QRVCrashPoint(services, "migration.acl-standardized");
  }
  if (failed) return false;
  status->setMigrationCompleteForType(QRVMigrationStatus::kACLMigration);
  return true;
}

bool QRVContainerMigrator::_performBundleContainerOwnershipMigrationWithError(QRVServices& services, QRVError* error) {
  std::unique_ptr<QRVMigrationStatus> status = QRVMigrationStatus::initForSystemMigration(services);
  if (!status)
    return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput, "The migration status cannot be read"));
  if (status->hasMigrationOccurredForType(QRVMigrationStatus::kBundleMigration)) return true;
  QRVLogNotice("Changing ownership of bundle container content.");
  const std::string bundles = services.globalConfiguration->bundleDirectory();
  QRVError ownershipError;
  if (!services.fileManager->standardizeOwnershipAtURL(bundles, CONTAINER_INSTALLATION_UID,
                                                       CONTAINER_INSTALLATION_UID, &ownershipError)) {
    QRVLogError("Failed to change owner of {}: {}", bundles, ownershipError.description());
    return QRVFail(error, ownershipError);
  }
  QRVCrashPoint(services, "migration.bundle-owned");
  status->setMigrationCompleteForType(QRVMigrationStatus::kBundleMigration);
  return true;
}

// ---- Per-user data ----

bool QRVContainerMigrator::performPerUserDataMigrationForClientConnection(QRVClientConnection&, QRVError* error) {
  std::shared_ptr<QRVServices> services = _services(error);
  if (!services) return false;
  return QRVGuarded(services->globalConfiguration->isInternalImage(), error, false, [&] {
    _performSubdirectoryMigration(services);
    _performDataProtectionMigration(services);
    return true;
  });
}

// Containers made by older releases may lack subdirectories that the
// current one makes for every container of their class.
void QRVContainerMigrator::_performSubdirectoryMigration(const std::shared_ptr<QRVServices>& services) {
  std::unique_ptr<QRVMigrationStatus> status = QRVMigrationStatus::initForMobileUserMigration(*services);
  if (!status || status->hasMigrationOccurredForType(QRVMigrationStatus::kSubdirectoryMigration)) return;
  bool everyoneSucceeded = true;
  services->userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [&](const QRVUserIdentityRef& user) {
        everyoneSucceeded = _migrateSubdirectoriesForUserIdentity(services, user) && everyoneSucceeded;
      });
  if (everyoneSucceeded) status->setMigrationCompleteForType(QRVMigrationStatus::kSubdirectoryMigration);
}

bool QRVContainerMigrator::_migrateSubdirectoriesForUserIdentity(const std::shared_ptr<QRVServices>& services,
                                                                 const QRVUserIdentityRef& user) {
  const std::string who = user->description();
  const std::string build = QRVMigrationStatus::currentBuildVersion(*services);
  QRVLogNotice("Performing Per User Subdirectory Migration for {} on {}", who, build);
  std::shared_ptr<QRVClientConnection> connection = QRVClientConnection::makePrivilegedClientConnection(user, services);
  std::vector<QRVContainerClass> perUserClasses;
  for (QRVContainerClass c = 1; c < QRVContainerClassMax; ++c)
    if (QRVContainerClassIsPerUser(c)) perUserClasses.push_back(c);
  const bool succeeded =
      _forEachContainerOfUserIdentity(*services, user, perUserClasses, [&](const QRVMetadataRef& container) {
        QRVError error;
        return connection->recreateDefaultStructureWithContainerIdentity(container->containerIdentity(), &error);
      });
  QRVLogNotice("Completed Per User Subdirectory Migration for {} on {} : Success: {}", who, build,
               succeeded ? 'Y' : 'N');
  QRVCrashPoint(*services, "migration.user-subdirectories-made");
  return succeeded;
}

void QRVContainerMigrator::_performDataProtectionMigration(const std::shared_ptr<QRVServices>& services) {
  services->userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [&](const QRVUserIdentityRef& user) { _migrateDataProtectionForUserIdentity(services, user); });
}

void QRVContainerMigrator::_migrateDataProtectionForUserIdentity(const std::shared_ptr<QRVServices>& services,
                                                                 const QRVUserIdentityRef& user) {
  const std::string who = user->description();
  const std::string build = QRVMigrationStatus::currentBuildVersion(*services);
  QRVLogNotice("Performing User Data Protection Migration for {} on {}", who, build);
  std::shared_ptr<QRVClientConnection> connection = QRVClientConnection::makePrivilegedClientConnection(user, services);
  const bool succeeded = _forEachContainerOfUserIdentity(
      *services, user, {QRVContainerClassAppData, QRVContainerClassPluginData}, [&](const QRVMetadataRef& container) {
        _setDataProtectionIfNecessaryOnContainer(*connection, container);
        return true;
      });
  QRVLogNotice("Completed User Data Protection Migration for {} on {} : Success: {}", who, build,
               succeeded ? 'Y' : 'N');
}

bool QRVContainerMigrator::_forEachContainerOfUserIdentity(QRVServices& services, const QRVUserIdentityRef& user,
                                                           const std::vector<QRVContainerClass>& classes,
                                                           const std::function<bool(const QRVMetadataRef&)>& body) {
  bool succeeded = true;
  for (QRVContainerClass containerClass : classes) {
    QRVError error;
    std::optional<std::vector<QRVMetadataRef>> containers =
        services.containerCache->allContainersForUserIdentity(user, containerClass, false, &error);
    if (!containers) {
      QRVLogError("Failed to fetch list of data containers for userIdentity: {}, class: {}: {}", user->description(),
                  static_cast<long>(containerClass), error.description());
      succeeded = false;
      continue;
    }
    for (const QRVMetadataRef& container : *containers) succeeded = body(container) && succeeded;
  }
  return succeeded;
}

// An installed application's bundle container: the same identifier, class
// 1, in the data container's user context. 21 when there is none.
QRVMetadataRef QRVContainerMigrator::_bundleContainerForDataContainer(QRVClientConnection& connection,
                                                                     const QRVMetadata& dataContainer,
                                                                     QRVError* error) {
  QRVContainerIdentityRef bundle = QRVContainerIdentity::containerIdentityWithUserIdentity(
      dataContainer.userIdentity(), dataContainer.identifier(), QRVContainerClassAppBundle, error);
  if (!bundle) return nullptr;
  return connection.createOrLookupContainerWithContainerIdentity(bundle, /*createIfNecessary=*/false,
                                                                 /*transient=*/false, /*useLocking=*/true, error);
}

// The class of an installed application's data container is the
// installer's to set. A data container without an application (a plug-in's
// or a daemon's) gets the class its entitlements ask for.
void QRVContainerMigrator::_setDataProtectionIfNecessaryOnContainer(QRVClientConnection& connection,
                                                                   const QRVMetadataRef& container) {
  QRVServices& services = connection.services();
  QRVError error;
  if (_bundleContainerForDataContainer(connection, *container, &error)) return;
  if (error.domain() != QRVError::kDomain || error.code() != QRVResultCode::kNoSuchContainer) {
    QRVLogError("Error looking up bundle container for {} : {}", container->identifier(), error.description());
    return;
  }
  if (!services.dataProtectionManager) return;
  const uint32_t protectionClass =
      services.dataProtectionManager->intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
          container->identifier());
  services.dataProtectionManager->setDataProtectionOnDataContainerForContainerIdentity(
      container->containerIdentity(), static_cast<int32_t>(protectionClass), /*isSecondOrThirdPartyApp=*/false,
      /*retryIfLocked=*/false, [protectionClass, container](const QRVError* failure) {
        if (!failure) return;
        QRVLogError("Error setting protection class {} on {}:{} ({}) : {}", protectionClass, container->identifier(),
                    container->containerClass(), container->userIdentity()->description(), failure->resultCode());
      });
}

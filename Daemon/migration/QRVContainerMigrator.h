// The one-time migrations that bring an older on-disk layout up to date: at
// the first start on a new build, and when the data migrator (command 24) or
// a client after an upgrade (command 30) asks for them.
//
// Each step that can be repeated harmlessly simply runs again; each that must
// not is recorded in the migration status under its own name once it has
// succeeded, and a step that failed is left unrecorded so that it runs again
// at the next opportunity. The migrator keeps no state of its own.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/QRVError.h"
#include "model/QRVMetadata.h"

class QRVClientConnection;
class QRVMigrationStatus;
struct QRVServices;

class QRVContainerMigrator {
 public:
  // Where a device of a much older layout kept the bundle containers: in the
  // mobile user's home.
  static constexpr const char* kOldBundleContainersPath = "/private/var/mobile/Containers/Bundle";

  // The services own the migrator; it holds them weakly.
  explicit QRVContainerMigrator(std::weak_ptr<QRVServices> services);

  // At the first start on a new build, in this order: the log files of the
  // old log directory (not on a multi-user host), the bundle tree from its
  // old location, the check whether system containers need their ACLs
  // migrated at all, the well-known containers. Fails, leaving the later
  // steps for the next upgrade, when the bundle tree cannot be moved.
  bool performSynchronousBuildUpgradeMigration(QRVMigrationStatus& status, QRVError* error);
  // ACLs of system and system group containers, ownership of the bundle
  // tree, then the code-signing migrations and reconciliation with the
  // connection's command queue. A failing step is logged and the next one
  // runs. Only an exception fails it (40).
  bool performDataMigratorMigrationForClientConnection(QRVClientConnection& connection, QRVError* error);
  // The default subdirectories of every user's per-user containers (once),
  // then the protection class of data containers that have no bundle
  // container (every time: the class follows the entitlements, which may
  // have changed). Only an exception fails it (40).
  bool performPerUserDataMigrationForClientConnection(QRVClientConnection& connection, QRVError* error);

 private:
  std::shared_ptr<QRVServices> _services(QRVError* error) const;

  void _migrateLogFiles(QRVServices& services);
  bool _relocateBundleContainers(QRVServices& services, QRVError* error);
  void _checkIfDeviceMayNeedSystemContainerACLMigration(QRVServices& services, QRVMigrationStatus& status);
  bool _performInternalACLMigrationWithError(QRVServices& services, QRVError* error);
  bool _performBundleContainerOwnershipMigrationWithError(QRVServices& services, QRVError* error);
  bool _performWhitelistMigrationWithError(QRVError* error);
  void _performDataMigratorSteps(QRVServices& services, QRVClientConnection& connection);
  void _performSubdirectoryMigration(const std::shared_ptr<QRVServices>& services);
  bool _migrateSubdirectoriesForUserIdentity(const std::shared_ptr<QRVServices>& services,
                                             const QRVUserIdentityRef& user);
  void _performDataProtectionMigration(const std::shared_ptr<QRVServices>& services);
  void _migrateDataProtectionForUserIdentity(const std::shared_ptr<QRVServices>& services,
                                             const QRVUserIdentityRef& user);
  // Calls `body` on each of the user's live containers of `classes`; false
  // when a listing failed (logged) or a call did.
  bool _forEachContainerOfUserIdentity(QRVServices& services, const QRVUserIdentityRef& user,
                                       const std::vector<QRVContainerClass>& classes,
                                       const std::function<bool(const QRVMetadataRef&)>& body);
  QRVMetadataRef _bundleContainerForDataContainer(QRVClientConnection& connection, const QRVMetadata& dataContainer,
                                                  QRVError* error);
  void _setDataProtectionIfNecessaryOnContainer(QRVClientConnection& connection, const QRVMetadataRef& container);

  std::weak_ptr<QRVServices> services_;
};

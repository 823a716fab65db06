#include "core/QRVMigrationHandlers.h"

#include "base/QRVLog.h"
#include "core/QRVServices.h"
#include "migration/QRVContainerMigrator.h"
#include "operations/QRVClientConnection.h"

// The function names below are what the log lines name.
namespace {

void performDataMigration(QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  if (connection.services().containerMigrator->performDataMigratorMigrationForClientConnection(connection, &error))
    return;
  QRVLogError("Failed to perform data migration : {}", error.description());
  *result = error.resultCode();
}

void performPerUserDataMigration(QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  if (connection.services().containerMigrator->performPerUserDataMigrationForClientConnection(connection, &error))
    return;
  QRVLogError("Failed to perform per-user data migration : {}", error.description());
  *result = error.resultCode();
}

}  // namespace

void QRVHandlePerformDataMigration(const QRVPlist&, const std::shared_ptr<QRVReply>&,
                                   QRVClientConnection& connection, uint64_t* result) {
  performDataMigration(connection, result);
}

void QRVHandlePerformPerUserDataMigration(const QRVPlist&, const std::shared_ptr<QRVReply>&,
                                          QRVClientConnection& connection, uint64_t* result) {
  performPerUserDataMigration(connection, result);
}

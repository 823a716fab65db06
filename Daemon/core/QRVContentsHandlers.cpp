#include "core/QRVContentsHandlers.h"

#include "core/QRVRequestUnpacking.h"
#include "operations/QRVClientConnection.h"

namespace {

const QRVPlist kNone;

const QRVPlist& objectForKey(const QRVPlist& request, const char* key) {
  const QRVPlist* value = request.get(key);
  return value ? *value : kNone;
}

// The application data container of "Identifier" for the user the request
// names: the one that holds user-managed assets.
QRVContainerIdentityRef assetsContainerIdentity(const QRVPlist& request, QRVClientConnection& connection,
                                                QRVError* error) {
  const QRVPlist* identifier = request.get("Identifier");
  if (!identifier || !identifier->isString()) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput, "Missing or non-string identifier"));
    return nullptr;
  }
  QRVUserIdentityRef user =
      QRVRequestUnpacking::userIdentityForContainerIdentifier(request, QRVContainerClassAppData, connection, error);
  return user ? QRVContainerIdentity::containerIdentityWithUserIdentity(user, identifier->stringValue(),
                                                                         QRVContainerClassAppData, error)
              : nullptr;
}

}  // namespace

void QRVHandleSetInfoValue(const QRVPlist& request, const std::shared_ptr<QRVReply>&,
                           QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  QRVConcreteContainerIdentityRef identity = QRVRequestUnpacking::concreteContainerIdentity(request, connection, &error);
  if (!identity ||
      !connection.setInfoValue(objectForKey(request, "Value"), objectForKey(request, "Key"), identity, true, &error))
    *result = error.resultCode();
}

void QRVHandleInfoValueForKey(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                              QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  QRVConcreteContainerIdentityRef identity = QRVRequestUnpacking::concreteContainerIdentity(request, connection, &error);
  std::optional<QRVPlist> value =
      identity ? connection.infoValueForKey(objectForKey(request, "Key"), identity, true, &error) : std::nullopt;
  if (!value) {
    *result = error.resultCode();
    return;
  }
  reply->dictionary().set("ReplyInfoValue", std::move(*value));
}

void QRVHandleRegenerateDirectoryUUID(const QRVPlist& request, const std::shared_ptr<QRVReply>&,
                                      QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  QRVConcreteContainerIdentityRef identity = QRVRequestUnpacking::concreteContainerIdentity(request, connection, &error);
  if (!identity || !connection.regenerateDirectoryUUIDWithContainerIdentity(identity, &error))
    *result = error.resultCode();
}

void QRVHandleDiskUsage(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                        QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  QRVConcreteContainerIdentityRef identity = QRVRequestUnpacking::concreteContainerIdentity(request, connection, &error);
  std::optional<uint64_t> usage = identity ? connection.diskUsageWithContainerIdentity(identity, &error) : std::nullopt;
  if (!usage) {
    *result = error.resultCode();
    return;
  }
  reply->dictionary().set("ReplyDiskUsage", QRVPlist::uinteger(*usage));
}

void QRVHandleStageSharedContent(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                 QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  std::optional<std::string> path = connection.stageSharedContentForIdentifier(
      request.stringForKey("Identifier"), request.stringForKey("SourcePath"), request.stringForKey("DestPath"), &error);
  if (!path) {
    *result = error.resultCode();
    return;
  }
  reply->dictionary().set("ReplyPath", QRVPlist::string(*path));
}

void QRVHandleUserManagedAssetsPath(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                    QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  QRVContainerIdentityRef identity = assetsContainerIdentity(request, connection, &error);
  bool existed = false;
  std::optional<std::string> path =
      identity ? connection.userManagedAssetsPathWithContainerIdentity(identity, request.boolForKey("IsRelative"),
                                                                       request.boolForKey("CreateIfNecessary"),
                                                                       &existed, &error)
               : std::nullopt;
  if (!path) {
    *result = error.resultCode();
    return;
  }
  reply->dictionary().set("ReplyPath", QRVPlist::string(*path));
  reply->dictionary().set("ReplyExisted", QRVPlist::boolean(existed));
}

void QRVHandleDeleteUserManagedAsset(const QRVPlist& request, const std::shared_ptr<QRVReply>&,
                                     QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  QRVContainerIdentityRef identity = assetsContainerIdentity(request, connection, &error);
  if (!identity ||
      !connection.deleteUserManagedAssetWithContainerIdentity(identity, request.stringForKey("SourcePath"), &error))
    *result = error.resultCode();
}

#include "core/QRVDeleteHandlers.h"

#include "base/QRVLog.h"
#include "core/QRVRequestUnpacking.h"
#include "operations/QRVClientConnection.h"

namespace {

// A UUID given as 16 bytes or as its text form, normalised to the bytes the
// identity unpacking reads.
std::optional<QRVPlist> uuidAsData(const QRVPlist* value) {
  if (!value) return std::nullopt;
  if (value->isString()) {
    std::optional<QRVUUID> uuid = QRVUUID::fromString(value->stringValue());
    if (!uuid) return std::nullopt;
    return QRVPlist::data(QRVPlist::Bytes(uuid->bytes().begin(), uuid->bytes().end()));
  }
  return *value;
}

// The keys of one side of a replace ("Old" or "New") as the plain keys the
// identity unpacking reads.
QRVPlist sideOfReplace(const QRVPlist& request, const std::string& prefix) {
  QRVPlist side = QRVPlist::dictionary();
  for (const char* key : {"Identifier", "ContainerClass", "PersonaUniqueString"})
    if (const QRVPlist* v = request.get(prefix + key)) side.set(key, *v);
  if (auto uuid = uuidAsData(request.get(prefix + "ContainerUUID"))) side.set("UUID", *uuid);
  return side;
}

QRVContainerIdentityRef identityOfSide(const QRVPlist& side, QRVClientConnection& connection, QRVError* error) {
  if (side.get("UUID")) return QRVRequestUnpacking::concreteContainerIdentity(side, connection, error);
  return QRVRequestUnpacking::containerIdentity(side, connection, error);
}

}  // namespace

void QRVHandleReplaceContainer(const QRVPlist& request, const std::shared_ptr<QRVReply>&,
                               QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  QRVContainerIdentityRef oldIdentity = identityOfSide(sideOfReplace(request, "Old"), connection, &error);
  QRVContainerIdentityRef newIdentity =
      oldIdentity ? identityOfSide(sideOfReplace(request, "New"), connection, &error) : nullptr;
  // The command names no preserved UUID: the new container keeps its own.
  if (!oldIdentity || !newIdentity ||
      !connection.replaceContainerIdentity(oldIdentity, newIdentity, /*preserveOldUUID=*/false,
                                           /*startDeletionThread=*/true, &error))
    *result = error.resultCode();
}

void QRVHandleStageContainerForDelete(const QRVPlist& request, const std::shared_ptr<QRVReply>&,
                                      QRVClientConnection& connection, uint64_t* result) {
  const QRVPlist::Array& classes = request.arrayForKey("ContainerClassesArray");
  const QRVPlist::Array& uuids = request.arrayForKey("UUIDsArray");
  const QRVPlist::Array& identifiers = request.arrayForKey("IdentifiersArray");
  const QRVPlist::Array& personas = request.arrayForKey("PersonaUniqueStringsArray");
  if (uuids.size() != classes.size() || identifiers.size() != classes.size() || personas.size() != classes.size()) {
    QRVLogError(
        "Can't act on an invalid input: UUIDString count: {}, class count: {}, ID count: {}, persona string "
        "count: {}",
        uuids.size(), classes.size(), identifiers.size(), personas.size());
    *result = QRVResultCode::kInvalidInput;
    return;
  }
  std::vector<QRVContainerIdentityRef> identities;
  for (size_t i = 0; i < classes.size(); i++) {
    QRVPlist one = QRVPlist::dictionary();
    one.set("Identifier", identifiers[i]);
    one.set("ContainerClass", classes[i]);
    QRVContainerClass containerClass = classes[i].type() == QRVPlist::Type::UInteger ? classes[i].uint64Value() : 0;
    // The persona only matters to classes kept per user; the others live in
    // the default identity's tree.
    if (QRVUserIdentity::isUserIdentityRequiredForContainerClass(containerClass) && personas[i].isString() &&
        !personas[i].stringValue().empty())
      one.set("PersonaUniqueString", personas[i]);
    if (auto uuid = uuidAsData(&uuids[i])) one.set("UUID", *uuid);
    QRVError error;
    QRVContainerIdentityRef identity = QRVRequestUnpacking::concreteContainerIdentity(one, connection, &error);
    if (!identity) {
      QRVLogError("Skipping container {} of the delete request: {}", i, error.description());
      continue;
    }
    identities.push_back(std::move(identity));
  }
  connection.stageContainerIdentitiesForDelete(std::move(identities));
}

void QRVHandleDeleteContainersOnDeathRow(const QRVPlist&, const std::shared_ptr<QRVReply>& reply,
                                         QRVClientConnection& connection, uint64_t*) {
  connection.deleteContainersOnDeathRowWithCompletion([reply] {
    reply->dictionary().set("ReplyError", QRVPlist::uinteger(QRVResultCode::kSuccess));
    reply->send();
  });
}

void QRVHandleDeleteContainer(const QRVPlist& request, const std::shared_ptr<QRVReply>&,
                              QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  QRVContainerIdentityRef identity = QRVRequestUnpacking::containerIdentity(request, connection, &error);
  if (!identity || !connection.deleteContainerWithContainerIdentity(identity, request.boolForKey("Transient"), &error))
    *result = error.resultCode();
}

void QRVHandleWipeContainerContent(const QRVPlist& request, const std::shared_ptr<QRVReply>&,
                                   QRVClientConnection& connection, uint64_t* result) {
  QRVPlist fixed = request;
  fixed.set("ContainerClass", QRVPlist::uinteger(QRVContainerClassPluginData));
  QRVError error;
  QRVContainerIdentityRef identity = QRVRequestUnpacking::containerIdentity(fixed, connection, &error);
  if (!identity || !connection.deleteDataContainerContentWithContainerIdentity(identity, &error))
    *result = error.resultCode();
}

void QRVHandleDeleteContainerContent(const QRVPlist& request, const std::shared_ptr<QRVReply>&,
                                     QRVClientConnection& connection, uint64_t* result) {
  connection.setUnrestricted(true);
  QRVError error;
  QRVContainerIdentityRef identity = QRVRequestUnpacking::containerIdentity(request, connection, &error);
  if (!identity || !connection.deleteDataContainerContentWithContainerIdentity(identity, &error))
    *result = error.resultCode();
}

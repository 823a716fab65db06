#include "core/QRVContainerHandlers.h"

#include "core/QRVRequestUnpacking.h"
#include "operations/QRVClientConnection.h"

namespace {

QRVPlist uuidData(const QRVUUID& uuid) { return QRVPlist::data(QRVPlist::Bytes(uuid.bytes().begin(), uuid.bytes().end())); }

}  // namespace

void QRVHandleCreateOrLookupContainer(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                      QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  QRVContainerIdentityRef identity = QRVRequestUnpacking::containerIdentity(request, connection, &error);
  QRVMetadataRef metadata =
      identity ? connection.createOrLookupContainerWithContainerIdentity(
                     identity, request.boolForKey("CreateIfNecessary"), request.boolForKey("Transient"), true, &error)
               : nullptr;
  if (!metadata) {
    *result = error.resultCode();
    return;
  }
  QRVPlist& out = reply->dictionary();
  out.set("ReplyUUID", uuidData(metadata->uuid()));
  out.set("ReplyExisted", QRVPlist::boolean(metadata->existed()));
  out.set("ReplyPath", QRVPlist::string(metadata->url()));
  out.set("ReplyIdentifier", QRVPlist::string(metadata->identifier()));
  // Always present, empty for a user without a persona, as in the parallel
  // arrays of command 1: clients read the key without first asking whether
  // the container's user has one.
  out.set("ReplyPersonaUniqueString", QRVPlist::string(metadata->userIdentity()->personaUniqueString()));
  if (auto token = QRVRequestUnpacking::issueSandboxExtension(connection, *metadata))
    out.set("SandboxToken", QRVPlist::string(*token));
}

void QRVHandleContainersWithClass(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                  QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  auto containers = connection.containersWithClass(request.uint64ForKey("ContainerClass"),
                                                   request.boolForKey("Transient"), &error);
  if (!containers) {
    *result = error.resultCode();
    return;
  }
  QRVPlist ids = QRVPlist::array(), uuids = QRVPlist::array(), personas = QRVPlist::array();
  for (const QRVMetadataRef& m : *containers) {
    ids.append(QRVPlist::string(m->identifier()));
    uuids.append(uuidData(m->uuid()));
    personas.append(QRVPlist::string(m->userIdentity()->personaUniqueString()));
  }
  reply->dictionary().set("ReplyIdsArray", std::move(ids));
  reply->dictionary().set("ReplyUUIDsArray", std::move(uuids));
  reply->dictionary().set("ReplyPersonaUniqueStringsArray", std::move(personas));
}

void QRVHandleContainerMetadata(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  QRVConcreteContainerIdentityRef identity = QRVRequestUnpacking::concreteContainerIdentity(request, connection, &error);
  QRVMetadataRef metadata = identity ? connection.metadataWithContainerIdentity(identity, &error) : nullptr;
  if (!metadata) {
    *result = error.resultCode();
    return;
  }
  QRVPlist& out = reply->dictionary();
  out.set("ReplyPath", QRVPlist::string(metadata->url()));
  out.set("ReplyTransient", QRVPlist::boolean(metadata->transient()));
  if (request.boolForKey("InfoDictRequested"))
    out.set("ReplyInfoDictionary", metadata->info().isDictionary() ? metadata->info() : QRVPlist::dictionary());
  if (auto token = QRVRequestUnpacking::issueSandboxExtension(connection, *metadata))
    out.set("SandboxToken", QRVPlist::string(*token));
}

void QRVHandleRecreateDefaultStructure(const QRVPlist& request, const std::shared_ptr<QRVReply>&,
                                       QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  QRVConcreteContainerIdentityRef identity = QRVRequestUnpacking::concreteContainerIdentity(request, connection, &error);
  if (!identity || !connection.recreateDefaultStructureWithContainerIdentity(identity, &error))
    *result = error.resultCode();
}

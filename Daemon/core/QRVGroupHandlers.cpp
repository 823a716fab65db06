#include "core/QRVGroupHandlers.h"

#include <algorithm>

#include "base/QRVLog.h"
#include "codesigning/QRVCodeSigningMapping.h"
#include "codesigning/QRVGroupManager.h"
#include "codesigning/QRVWhitelist.h"
#include "core/QRVRequestUnpacking.h"
#include "operations/QRVClientConnection.h"

namespace {

// The owner and class arguments of commands 13, 14 and 16.
struct GroupArguments {
  std::string owner;
  QRVContainerClass groupClass = QRVContainerClassUndefined;
};

bool unpackGroupArguments(const QRVPlist& request, QRVClientConnection& connection, GroupArguments* out,
                          QRVError* error) {
  // The commands that reach callers the trust store does not know need a
  // caller with a name: the owner defaults to it.
  if (!connection.clientIdentity())
    return QRVFail(error, QRV_ERROR(QRVResultCode::kNotEntitled, "Unidentified caller may not name a group owner"));
  const QRVPlist* containerClass = request.get("ContainerClass");
  if (!containerClass || containerClass->type() != QRVPlist::Type::UInteger ||
      (containerClass->uint64Value() != QRVContainerClassAppGroup &&
       containerClass->uint64Value() != QRVContainerClassSystemGroup))
    return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidObject, "Invalid group container class: {}",
                                    containerClass ? containerClass->description() : std::string("(null)")));
  out->groupClass = containerClass->uint64Value();

  const QRVPlist* identifier = request.get("Identifier");
  if (identifier && !identifier->isString())
    return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidObject, "Can't act on an invalid object: ID: {}",
                                    identifier->description()));
  out->owner = identifier ? identifier->stringValue() : connection.clientIdentity()->bundleIdentifier();
  if (out->owner.empty())
    return QRVFail(error,
                   QRV_ERROR(QRVResultCode::kMissingIdentifier, "No group owner: {} has no identifier", "(null)"));
  return true;
}

// Commands 13 and 16: the owner's containers, each created when missing.
std::optional<std::map<std::string, QRVMetadataRef>> groupContainers(const QRVPlist& request,
                                                                     QRVClientConnection& connection,
                                                                     bool logForeignOwner, QRVError* error) {
  GroupArguments arguments;
  if (!unpackGroupArguments(request, connection, &arguments, error)) return std::nullopt;
  const std::string& caller = connection.clientIdentity()->bundleIdentifier();
  if (logForeignOwner && arguments.owner != caller)
    QRVLogNotice("{} trying to look up persona for group owner {}", caller, arguments.owner);
  QRVUserIdentityRef user =
      QRVRequestUnpacking::userIdentityForContainerIdentifier(request, arguments.groupClass, connection, error);
  if (!user) return std::nullopt;
  return connection.groupContainersForOwnerIdentifier(arguments.owner, user, arguments.groupClass, error);
}

}  // namespace

void QRVHandleCreateOrLookupGroupContainers(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                            QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  auto containers = groupContainers(request, connection, /*logForeignOwner=*/true, &error);
  if (!containers) {
    *result = error.resultCode();
    return;
  }
  QRVPlist paths = QRVPlist::dictionary(), tokens = QRVPlist::dictionary();
  for (const auto& [groupIdentifier, container] : *containers) {
    paths.set(groupIdentifier, QRVPlist::string(container->url()));
    // A group whose token cannot be issued is still handed out (logged):
    // the caller may reach it by other means.
    if (auto token = QRVRequestUnpacking::issueSandboxExtension(connection, *container))
      tokens.set(groupIdentifier, QRVPlist::string(*token));
  }
  reply->dictionary().set("ReplyGroupContainerDict", std::move(paths));
  reply->dictionary().set("SandboxTokenDict", std::move(tokens));
}

void QRVHandleGroupContainerIdentifiersForOwner(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                                QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  GroupArguments arguments;
  std::optional<std::vector<std::string>> identifiers;
  if (unpackGroupArguments(request, connection, &arguments, &error))
    identifiers = connection.services().groupManager->groupContainerIdentifiersForOwnerIdentifier(
        arguments.owner, arguments.groupClass, /*useLocking=*/true, &error);
  if (!identifiers) {
    *result = error.resultCode();
    return;
  }
  QRVPlist array = QRVPlist::array();
  for (const std::string& identifier : *identifiers) array.append(QRVPlist::string(identifier));
  reply->dictionary().set("ReplyGroupIdentifiersArray", std::move(array));
}

void QRVHandleGroupContainersForOwner(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                      QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  auto containers = groupContainers(request, connection, /*logForeignOwner=*/false, &error);
  if (!containers) {
    *result = error.resultCode();
    return;
  }
  QRVPlist paths = QRVPlist::dictionary();
  for (const auto& [groupIdentifier, container] : *containers)
    paths.set(groupIdentifier, QRVPlist::string(container->url()));
  reply->dictionary().set("ReplyGroupContainerDict", std::move(paths));
}

void QRVHandleLookupSystemContainer(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                    QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  const QRVPlist* containerClass = request.get("ContainerClass");
  if (!containerClass || containerClass->type() != QRVPlist::Type::UInteger ||
      containerClass->uint64Value() != QRVContainerClassSystemData) {
    QRVFail(&error, QRV_ERROR(QRVResultCode::kInvalidObject, "Invalid system container class: {}",
                              containerClass ? containerClass->description() : std::string("(null)")));
    *result = error.resultCode();
    return;
  }
  QRVContainerIdentityRef identity = QRVRequestUnpacking::containerIdentity(request, connection, &error);
  // Well-known system containers belong to services that expect them to be
  // there; any other system container is made by the installer, never here.
  QRVMetadataRef container =
      identity ? connection.createOrLookupContainerWithContainerIdentity(
                     identity,
                     /*createIfNecessary=*/
                     connection.services().wellKnownNames->systemContainerIdIsWellknown(identity->identifier()),
                     /*transient=*/false, /*useLocking=*/true, &error)
               : nullptr;
  if (!container) {
    *result = error.resultCode();
    return;
  }
  reply->dictionary().set("ReplyPath", QRVPlist::string(container->url()));
}

void QRVHandleSystemGroupContainerPath(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                       QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  QRVServices& services = connection.services();
  const QRVPlist* groupIdentifierValue = request.get("GroupIdentifier");
  if (!connection.clientIdentity()) {
    QRVFail(&error, QRV_ERROR(QRVResultCode::kNotEntitled, "Unidentified caller may not name a system group"));
  } else if (!groupIdentifierValue) {
    QRVFail(&error, QRV_ERROR(QRVResultCode::kMissingIdentifier, "Missing system group identifier"));
  } else if (!groupIdentifierValue->isString() || groupIdentifierValue->stringValue().empty()) {
    QRVFail(&error, QRV_ERROR(QRVResultCode::kInvalidObject, "Invalid system group identifier: {}",
                              groupIdentifierValue->description()));
  }
  if (error.code() != 0) {
    *result = error.resultCode();
    return;
  }
  const std::string& caller = connection.clientIdentity()->bundleIdentifier();
  const std::string& groupIdentifier = groupIdentifierValue->stringValue();

  // Every process may reach the shared system group; any other only when
  // the caller's own code signing lists it.
  if (groupIdentifier != QRVWhitelist::kSharedSystemGroupIdentifier) {
    std::vector<std::string> entitled;
    if (services.codeSigningMapping && !caller.empty())
      entitled = services.codeSigningMapping->systemGroupIdentifiersForIdentifier(caller);
    if (std::find(entitled.begin(), entitled.end(), groupIdentifier) == entitled.end()) {
      QRVPlist listed = QRVPlist::array();
      for (const std::string& g : entitled) listed.append(QRVPlist::string(g));
      QRVLogError("{} is not entitled for system group identifier: {}.  Only entitled for: {}",
                  caller.empty() ? std::string("(null)") : caller, groupIdentifier, listed.description());
      *result = QRVResultCode::kNotEntitled;
      return;
    }
  }
  connection.setAllowGroupIdLookup(true);

  QRVContainerIdentityRef identity = QRVContainerIdentity::containerIdentityWithUserIdentity(
      services.userIdentityCache->defaultUserIdentity(), groupIdentifier, QRVContainerClassSystemGroup, &error);
  QRVMetadataRef container =
      identity ? connection.createOrLookupContainerWithContainerIdentity(
                     identity,
                     /*createIfNecessary=*/services.wellKnownNames->systemGroupContainerIdIsWellknown(groupIdentifier),
                     /*transient=*/false, /*useLocking=*/true, &error)
               : nullptr;
  if (!container) {
    if (error.code() == QRVResultCode::kNoSuchContainer)
      QRVLogNotice("Did not find system group container with identifier: {} for {}", groupIdentifier, caller);
    *result = error.resultCode();
    return;
  }
  reply->dictionary().set("ReplyPath", QRVPlist::string(container->url()));
}

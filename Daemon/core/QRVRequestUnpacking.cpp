#include "core/QRVRequestUnpacking.h"

#include "base/QRVLog.h"

namespace QRVRequestUnpacking {

QRVUserIdentityRef userIdentityForContainerIdentifier(const QRVPlist& request, QRVContainerClass containerClass,
                                                      QRVClientConnection& connection, QRVError* error) {
  QRVServices& services = connection.services();
  // The open commands also reach callers the trust store does not know. Such
  // a caller has no identifier and no user of its own, so no container is
  // its to name; everything after this point relies on an identity.
  if (!connection.clientIdentity()) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kNotEntitled, "Unidentified caller may not name a container"));
    return nullptr;
  }
  if (!QRVUserIdentity::isUserIdentityRequiredForContainerClass(containerClass))
    return services.userIdentityCache->defaultUserIdentity();
  const QRVUserIdentityRef& own = connection.clientIdentity()->userIdentity();
  const QRVPlist* persona = request.get("PersonaUniqueString");
  if (!persona || !persona->isString()) return own;

  QRVUserIdentityRef asked = services.userIdentityCache->userIdentityForPersonaUniqueString(
      persona->stringValue(), connection.clientIdentity()->posixUID(), connection.clientIdentity()->posixGID());
  if (!asked) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidObject, "Invalid object: no user identity for persona {}",
                             persona->stringValue()));
    return nullptr;
  }
  if (own && asked->isEqualToUserIdentity(*own)) return asked;
  QRVLogNotice("{} trying to look up persona for {}:{}", connection.clientIdentity()->bundleIdentifier(),
               containerClass, persona->stringValue());
  if (!connection.allowOtherIdLookup() && !connection.isUnrestricted()) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kNotEntitled, "{} not entitled to look up persona {}",
                             connection.clientIdentity()->bundleIdentifier(), persona->stringValue()));
    return nullptr;
  }
  return asked;
}

QRVContainerIdentityRef containerIdentity(const QRVPlist& request, QRVClientConnection& connection, QRVError* error) {
  const QRVPlist* identifier = request.get("Identifier");
  if (identifier && !identifier->isString()) {
    QRVFail(error,
            QRV_ERROR(QRVResultCode::kInvalidObject, "Invalid object: identifier = [{}]", identifier->description()));
    return nullptr;
  }
  QRVContainerClass containerClass = request.uint64ForKey("ContainerClass");
  QRVUserIdentityRef user = userIdentityForContainerIdentifier(request, containerClass, connection, error);
  if (!user) return nullptr;
  return QRVContainerIdentity::containerIdentityWithUserIdentity(
      user, identifier ? identifier->stringValue() : std::string(), containerClass, error);
}

QRVConcreteContainerIdentityRef concreteContainerIdentity(const QRVPlist& request, QRVClientConnection& connection,
                                                          QRVError* error) {
  QRVContainerIdentityRef base = containerIdentity(request, connection, error);
  if (!base) return nullptr;
  const QRVPlist::Bytes& bytes = request.dataForKey("UUID");
  std::optional<QRVUUID> uuid = QRVUUID::fromData(bytes.data(), bytes.size());
  if (!uuid) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidObject, "Invalid object: uuid = [{}]",
                             request.get("UUID") ? request.get("UUID")->description() : std::string("(null)")));
    return nullptr;
  }
  return QRVConcreteContainerIdentity::containerIdentityWithUUID(*uuid, base->userIdentity(), base->identifier(),
                                                                 base->containerClass(), error);
}

std::optional<std::string> issueSandboxExtension(QRVClientConnection& connection, const std::string& path,
                                                 const char* extensionClass) {
  int errnum = 0;
  std::optional<std::string> token = connection.services().platform.sandbox->issueExtension(
      extensionClass, path, connection.clientIdentity()->auditToken(), &errnum);
  if (!token)
    QRVLogError("sandbox_extension_issue_file failed for {} at path {}: {}",
                connection.clientIdentity()->bundleIdentifier(), path, errnum);
  return token;
}

std::optional<std::string> issueSandboxExtension(QRVClientConnection& connection, const QRVMetadata& container) {
  const char* extensionClass = container.containerClass() == QRVContainerClassAppGroup ? kApplicationGroupExtensionClass
                                                                                       : kContainerExtensionClass;
  return issueSandboxExtension(connection, container.url(), extensionClass);
}

}  // namespace QRVRequestUnpacking

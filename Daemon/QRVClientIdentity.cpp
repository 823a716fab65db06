#include "QRVClientIdentity.h"

#include "QRVLog.h"

QRVClientIdentity::QRVClientIdentity(std::string bundleIdentifier, uid_t uid, gid_t gid, pid_t pid,
                                     QRVPlist entitlements, bool sandboxed, QRVAuditToken auditToken)
    : bundleIdentifier_(std::move(bundleIdentifier)),
      uid_(uid),
      gid_(gid),
      pid_(pid),
      entitlements_(std::move(entitlements)),
      sandboxed_(sandboxed),
      auditToken_(auditToken) {}

std::shared_ptr<const QRVClientIdentity> QRVClientIdentity::clientIdentityWithRelayConnection(
    const QRVConnection& connection, QRVServices& services) {
  const QRVAuditToken& token = connection.auditToken();
  QRVError error;
  std::optional<std::string> signingIdentifier =
      services.platform.trustStore->signingIdentifierForAuditToken(token, &error);

  std::optional<QRVPlist> entitlements = services.platform.trustStore->entitlementsForAuditToken(token);
  if (!entitlements || !entitlements->isDictionary()) {
    QRVLogError("Missing or malformed entitlements for pid {}", connection.pid());
    entitlements = QRVPlist::dictionary();
  }
  bool sandboxed = services.platform.sandbox->isSandboxed(token);

  std::shared_ptr<const QRVClientIdentity> identity;
  if (!signingIdentifier) {
    QRVLogError("Failed to copy signing ID for pid {} : {}", connection.pid(), error.description());
  } else {
    identity = std::make_shared<const QRVClientIdentity>(*signingIdentifier, connection.euid(), connection.egid(),
                                                         connection.pid(), std::move(*entitlements), sandboxed,
                                                         token);
  }
  QRVLogInfo("[{}] Relay client identity: {}", signingIdentifier.value_or("<unknown>"),
             identity ? identity->description() : "(null)");
  return identity;
}

std::shared_ptr<const QRVClientIdentity> QRVClientIdentity::anonymousPrivilegedClientIdentity() {
  static const auto identity = std::make_shared<const QRVClientIdentity>(
      "com.kelva.quorvad.internal", 0, 0, 0, QRVPlist::dictionary(), false, QRVAuditToken{});
  return identity;
}

bool QRVClientIdentity::boolValueOfEntitlement(const std::string& name) const {
  const QRVPlist* v = entitlements_.get(name);
  return v && v->truthValue();
}

std::string QRVClientIdentity::description() const {
  return fmt::format(
      "<QRVClientIdentity: {}; bundleIdentifier = {}, posixUID = {}, posixGID = {}, posixPID = {}, "
      "isSandboxed = {}, entitlements = {}>",
      static_cast<const void*>(this), bundleIdentifier_, uid_, gid_, pid_, sandboxed_ ? 1 : 0,
      entitlements_.description());
}

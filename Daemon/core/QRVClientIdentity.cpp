#include "core/QRVClientIdentity.h"

#include "base/QRVLog.h"
#include "base/QRVMutex.h"
#include "codesigning/QRVCodeSigningMapping.h"
#include "core/QRVBundleExecutable.h"

namespace {

// The installer's last identity. Read and written only under its lock, which
// is never held while the platform is asked anything.
QRVMutex gInstallerSlotLock;
std::shared_ptr<const QRVClientIdentity> gInstallerSlot GUARDED_BY(gInstallerSlotLock);

}  // namespace

QRVClientIdentity::QRVClientIdentity(std::string bundleIdentifier, uid_t uid, gid_t gid, pid_t pid,
                                     QRVUserIdentityRef userIdentity, QRVPlist entitlements, bool sandboxed,
                                     QRVAuditToken auditToken)
    : bundleIdentifier_(std::move(bundleIdentifier)),
      uid_(uid),
      gid_(gid),
      pid_(pid),
      userIdentity_(std::move(userIdentity)),
      entitlements_(std::move(entitlements)),
      sandboxed_(sandboxed),
      auditToken_(auditToken) {}

std::shared_ptr<const QRVClientIdentity> QRVClientIdentity::clientIdentityWithRelayConnection(
    const QRVConnection& connection, QRVServices& services, bool* keepable) {
  const QRVAuditToken& token = connection.auditToken();
  QRVUserIdentityRef userIdentity =
      services.userIdentityCache->userIdentityForCurrentContextWithUID(connection.euid(), connection.egid());
  QRVError error;
  std::optional<std::string> signingIdentifier =
      services.platform.trustStore->signingIdentifierForAuditToken(token, &error);
  // A program that runs from a bundle container is that container's
  // identifier, with the entitlements its code signing was installed with.
  std::optional<QRVPlist> bundleEntitlements;
  if (!signingIdentifier) {
    std::optional<std::string> executable = services.platform.trustStore->executablePathForUnlistedAuditToken(token);
    std::optional<QRVBundleExecutable::Owner> owner =
        executable ? QRVBundleExecutable::ownerOfExecutablePath(*executable, services) : std::nullopt;
    // The daemon's and the installer's names are never taken from a bundle.
    if (owner && owner->identifier != kInstallerIdentifier && owner->identifier != kPrivilegedIdentifier) {
      signingIdentifier = owner->identifier;
      if (services.codeSigningMapping)
        bundleEntitlements = services.codeSigningMapping->entitlementsForIdentifier(owner->identifier);
      if (!bundleEntitlements || !bundleEntitlements->isDictionary()) bundleEntitlements = QRVPlist::dictionary();
    }
  }
  const bool isInstaller = !bundleEntitlements && signingIdentifier && *signingIdentifier == kInstallerIdentifier;
  if (keepable) *keepable = signingIdentifier && !bundleEntitlements;

  std::shared_ptr<const QRVClientIdentity> identity;
  bool cached = false;
  if (isInstaller) {
    QRVMutexLock lock(&gInstallerSlotLock);
    if (gInstallerSlot && gInstallerSlot->auditToken() == token) {
      identity = gInstallerSlot;
      cached = true;
    }
  }
  if (!cached) {
    std::optional<QRVPlist> entitlements =
        bundleEntitlements ? bundleEntitlements : services.platform.trustStore->entitlementsForAuditToken(token);
    if (!entitlements || !entitlements->isDictionary()) {
      QRVLogError("Missing or malformed entitlements for pid {}", connection.pid());
      entitlements = QRVPlist::dictionary();
    }
    bool sandboxed = services.platform.sandbox->isSandboxed(token);
    if (!signingIdentifier) {
      QRVLogError("Failed to copy signing ID for pid {} : {}", connection.pid(), error.description());
    } else if (userIdentity) {
      identity = std::make_shared<const QRVClientIdentity>(*signingIdentifier, connection.euid(), connection.egid(),
                                                           connection.pid(), userIdentity, std::move(*entitlements),
                                                           sandboxed, token);
    }
    if (isInstaller) {
      QRVMutexLock lock(&gInstallerSlotLock);
      gInstallerSlot = identity;
    }
  }
  QRVLogInfo("[{}] Relay client identity: {}", signingIdentifier.value_or("<unknown>"),
             identity ? identity->description() : "(null)");
  return identity;
}

std::shared_ptr<const QRVClientIdentity> QRVClientIdentity::privilegedClientIdentityWithUserIdentity(
    QRVUserIdentityRef userIdentity) {
  return std::make_shared<const QRVClientIdentity>(kPrivilegedIdentifier, 0, 0, 0, std::move(userIdentity),
                                                   QRVPlist::dictionary(), false, QRVAuditToken{});
}

std::shared_ptr<const QRVClientIdentity> QRVClientIdentity::anonymousPrivilegedClientIdentity(
    QRVUserIdentityCache& cache) {
  return privilegedClientIdentityWithUserIdentity(cache.defaultUserIdentity());
}

bool QRVClientIdentity::boolValueOfEntitlement(const std::string& name) const {
  const QRVPlist* v = entitlements_.get(name);
  return v && v->truthValue();
}

std::string QRVClientIdentity::description() const {
  return fmt::format(
      "<QRVClientIdentity: {}; bundleIdentifier = {}, userIdentity = {}, posixUID = {}, posixGID = {}, "
      "posixPID = {}, isSandboxed = {}, entitlements = {}>",
      static_cast<const void*>(this), bundleIdentifier_, userIdentity_ ? userIdentity_->description() : "(null)",
      uid_, gid_, pid_, sandboxed_ ? 1 : 0, entitlements_.description());
}

#include "core/QRVRelayPeer.h"

#include "base/QRVLog.h"
#include "base/QRVResultCode.h"

namespace {

// Whether two user identities would give a client the same containers and
// owners: every field, not only the identifier that maps compare.
bool sameInEveryField(const QRVUserIdentity& a, const QRVUserIdentity& b) {
  return a.posixUID() == b.posixUID() && a.posixGID() == b.posixGID() && a.identifier() == b.identifier() &&
         a.homeDirectoryURL() == b.homeDirectoryURL() && a.personaType() == b.personaType() &&
         a.personaUniqueString() == b.personaUniqueString() && a.kernelPersonaID() == b.kernelPersonaID();
}

}  // namespace

std::shared_ptr<const QRVClientIdentity> QRVRelayPeer::clientIdentity(QRVConnection& connection,
                                                                      QRVServices& services) {
  // Read before the identity is built: a change that lands while it is being
  // built then shows at the next request.
  std::optional<QRVPeerProcessState> state = connection.peerProcessState();
  std::optional<uint64_t> trustStoreChanges = services.platform.trustStore->changeCount();
  if (state && trustStoreChanges && kept_ && kept_->state == *state &&
      kept_->trustStoreChanges == *trustStoreChanges) {
    QRVUserIdentityRef userIdentity =
        services.userIdentityCache->userIdentityForCurrentContextWithUID(connection.euid(), connection.egid());
    const QRVClientIdentity& identity = *kept_->identity;
    if (userIdentity && sameInEveryField(*userIdentity, *identity.userIdentity())) {
      QRVLogInfo("[{}] Relay client identity: {}", identity.bundleIdentifier(), identity.description());
      return kept_->identity;
    }
  }
  kept_.reset();
  bool keepable = false;
  std::shared_ptr<const QRVClientIdentity> identity =
      QRVClientIdentity::clientIdentityWithRelayConnection(connection, services, &keepable);
  if (identity && keepable && state && trustStoreChanges) kept_ = Kept{identity, *state, *trustStoreChanges};
  return identity;
}

uint64_t QRVRelayPeer::registerEntitlements(const std::shared_ptr<const QRVClientIdentity>& identity,
                                            const Registration& registration, uint64_t changeCount,
                                            QRVCommandQueue& queue) {
  if (registeredIdentity_ == identity && registeredAtChangeCount_ == changeCount) return QRVResultCode::kSuccess;
  registeredIdentity_.reset();
  uint64_t code = registration(identity->entitlements(), identity->bundleIdentifier(), queue);
  if (code == QRVResultCode::kSuccess) {
    registeredIdentity_ = identity;
    registeredAtChangeCount_ = changeCount;
  }
  return code;
}

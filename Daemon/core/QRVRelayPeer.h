// What the dispatcher keeps for one connection between its requests, so that
// a peer that has not changed is not identified from scratch every time.
//
// A process cannot change its credentials as the connection saw them, but it
// can exec another program or confine itself after connecting, and the trust
// store's entries, the code-signing database and the personas can change
// under it. The kept identity is therefore used again only while the peer's
// process state (QRVConnection::peerProcessState), the trust store's change
// count and the caller's user identity are all what they were when it was
// built; anything else builds it anew, exactly as the first request did.
// Identities taken from a bundle container (programs the trust store does
// not list) depend on the installed containers as well and are never kept.
//
// Used only by the thread delivering the connection's events, one request at
// a time, so it needs no lock.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>

#include "core/QRVClientIdentity.h"
#include "core/QRVCommandQueue.h"
#include "core/QRVServices.h"
#include "platform/QRVMessageService.h"

class QRVRelayPeer {
 public:
  using Registration = std::function<uint64_t(const QRVPlist& entitlements, const std::string& identifier,
                                              QRVCommandQueue& queue)>;

  // The identity of `connection`'s peer for the current request.
  std::shared_ptr<const QRVClientIdentity> clientIdentity(QRVConnection& connection, QRVServices& services);

  // Runs `registration` for `identity` unless it succeeded for this very
  // identity before and `changeCount` (the count of what the registration
  // reads; see QRVSQLiteDB::changeCount) has not moved since.
  uint64_t registerEntitlements(const std::shared_ptr<const QRVClientIdentity>& identity,
                                const Registration& registration, uint64_t changeCount, QRVCommandQueue& queue);

 private:
  struct Kept {
    std::shared_ptr<const QRVClientIdentity> identity;
    QRVPeerProcessState state;
    uint64_t trustStoreChanges = 0;
  };
  std::optional<Kept> kept_;

  std::shared_ptr<const QRVClientIdentity> registeredIdentity_;
  uint64_t registeredAtChangeCount_ = 0;
};

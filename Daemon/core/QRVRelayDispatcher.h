// The request dispatcher: reads a message's command, decides from the
// caller's entitlements whether and with which powers it may run it, runs the
// handler and the request's deferred commands, and sends exactly one reply.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "core/QRVClientIdentity.h"
#include "core/QRVCommandQueue.h"
#include "core/QRVCommandTable.h"
#include "core/QRVRelayPeer.h"
#include "core/QRVServices.h"
#include "platform/QRVMessageService.h"

// What a caller may do for one command.
struct QRVCallerPowers {
  bool entitled = false;
  bool allowOtherIdLookup = false;
  bool unrestricted = false;
  std::optional<QRVPlist> lookup;                    // the caller's "lookup" dictionary
  std::optional<QRVPlist::Array> entitledWipeIdentifiers;

  // Whether a connection is made for the request at all.
  bool mayConnect(const QRVCommandTableEntry& entry) const {
    return entitled || entry.allowedWithoutEntitlement || lookup.has_value();
  }
};

// The powers of `identity` (null: a caller that could not be identified,
// which has none) for `entry`'s command.
QRVCallerPowers QRVCallerPowersForCommand(const QRVCommandTableEntry& entry, const QRVClientIdentity* identity);

class QRVRelayDispatcher {
 public:
  // Records entitlements a caller registers for itself; returns 1 or an
  // error code. A failure is logged and does not refuse the request.
  using RegisteredEntitlementsProcessor =
      std::function<uint64_t(const QRVPlist& entitlements, const std::string& identifier, QRVCommandQueue& queue)>;

  explicit QRVRelayDispatcher(std::shared_ptr<QRVServices> services,
                              const QRVCommandTable& table = QRVDefaultCommandTable());

  // `changeCount`, when given, counts the changes of everything the
  // processor reads: a caller's registration that succeeded is not repeated
  // on its connection until the count moves (or its identity changes).
  void setRegisteredEntitlementsProcessor(RegisteredEntitlementsProcessor processor,
                                          std::function<uint64_t()> changeCount = nullptr) {
    processRegisteredEntitlements_ = std::move(processor);
    registrationChangeCount_ = std::move(changeCount);
  }

  // The per-connection event handler. `peer` is what the connection keeps
  // between its requests; without one, every request identifies its caller
  // from scratch.
  void QRVProcessRelayEvent(const std::shared_ptr<QRVConnection>& connection, const QRVConnectionEvent& event,
                            QRVRelayPeer* peer = nullptr);

 private:
  void runHandler(const QRVCommandTableEntry& entry, const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                  QRVClientConnection& connection, uint64_t* result);

  const std::shared_ptr<QRVServices> services_;
  const QRVCommandTable& table_;
  RegisteredEntitlementsProcessor processRegisteredEntitlements_;
  std::function<uint64_t()> registrationChangeCount_;
};

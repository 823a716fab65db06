#include "core/QRVRelayDispatcher.h"

#include <cstring>
#include <exception>

#include "base/QRVLog.h"
#include "base/QRVResultCode.h"
#include "core/QRVCurrentPersona.h"
#include "core/QRVExceptionReporter.h"
#include "operations/QRVClientConnection.h"

QRVCallerPowers QRVCallerPowersForCommand(const QRVCommandTableEntry& entry, const QRVClientIdentity* identity) {
  QRVCallerPowers p;
  if (!identity) return p;
  bool isTestability = strcmp(entry.entitlement, kEntitlementTestability) == 0;
  if (identity->boolValueOfEntitlement(kEntitlementAllowed)) {
    p.allowOtherIdLookup = true;
    // Test commands are never unrestricted: they need their own right.
    p.unrestricted = !isTestability;
  } else {
    p.allowOtherIdLookup = identity->boolValueOfEntitlement(kEntitlementOtherIdLookup);
    const QRVPlist* lookup = identity->valueOfEntitlement(kEntitlementLookup);
    if (entry.honoursLookupEntitlement && lookup && lookup->isDictionary()) p.lookup = *lookup;
  }
  if (strcmp(entry.entitlement, kEntitlementWipeContainer) == 0) {
    const QRVPlist* wipe = identity->valueOfEntitlement(kEntitlementWipeContainer);
    if (wipe && wipe->isArray()) {
      p.entitled = true;
      p.entitledWipeIdentifiers = wipe->arrayValue();
    } else {
      QRVLogError("No entitled containers to wipe");
      p.entitled = p.unrestricted;
    }
  } else {
    p.entitled = p.unrestricted || identity->boolValueOfEntitlement(entry.entitlement);
  }
  return p;
}

QRVRelayDispatcher::QRVRelayDispatcher(std::shared_ptr<QRVServices> services, const QRVCommandTable& table)
    : services_(std::move(services)), table_(table) {}

void QRVRelayDispatcher::QRVProcessRelayEvent(const std::shared_ptr<QRVConnection>& connection,
                                              const QRVConnectionEvent& event, QRVRelayPeer* peer) {
  if (event.kind == QRVConnectionEvent::Kind::kConnectionInvalid) return;

  const QRVPlist& request = event.message.body;
  const uint64_t command = request.uint64ForKey("Command");
  uint64_t result = QRVResultCode::kSuccess;
  std::shared_ptr<QRVReply> reply = QRVReply::createFrom(event.message);
  if (!reply) {
    QRVLogError("Dictionary does not have reply context");
    connection->cancel();
    return;
  }

  const QRVCommandTableEntry* entry = nullptr;
  if (command >= kQRVCommandCount) {
    QRVLogError("Invalid command index: {}", static_cast<long long>(command));
  } else if (table_[command].command != command) {
    QRVLogError("Invalid command at index {}", command);
  } else if (!table_[command].handler) {
    QRVLogError("Invalid command handler: {}", static_cast<long long>(command));
  } else {
    entry = &table_[command];
  }

  // While this request is handled, the thread acts in the peer's persona.
  QRVCurrentPersona::Scope persona(connection->personaID());
  auto commandQueue = std::make_shared<QRVCommandQueue>();
  std::shared_ptr<const QRVClientIdentity> identity =
      peer ? peer->clientIdentity(*connection, *services_)
           : QRVClientIdentity::clientIdentityWithRelayConnection(*connection, *services_);
  // A caller without a signing identifier has no name: the log lines say
  // "(null)", as they would of any missing object.
  const std::string clientName =
      identity && !identity->bundleIdentifier().empty() ? identity->bundleIdentifier() : "(null)";

  if (!entry) {
    result = QRVResultCode::kInvalidCommand;
  } else {
    QRVCallerPowers powers = QRVCallerPowersForCommand(*entry, identity.get());
    if (powers.mayConnect(*entry) && identity && processRegisteredEntitlements_) {
      uint64_t code =
          peer && registrationChangeCount_
              ? peer->registerEntitlements(identity, processRegisteredEntitlements_, registrationChangeCount_(),
                                           *commandQueue)
              : processRegisteredEntitlements_(identity->entitlements(), identity->bundleIdentifier(), *commandQueue);
      if (code != QRVResultCode::kSuccess)
        QRVLogError("Error processing entitlements for {} : {}", identity->bundleIdentifier(), code);
    }
    if (powers.mayConnect(*entry)) {
      QRVClientConnection clientConnection(identity, powers.entitled, powers.allowOtherIdLookup, powers.unrestricted,
                                           std::move(powers.lookup), std::move(powers.entitledWipeIdentifiers),
                                           commandQueue, services_);
      runHandler(*entry, request, reply, clientConnection, &result);
    } else {
      QRVLogError("connection attempt from pid {} ({}) is not entitled", connection->pid(), clientName);
      result = QRVResultCode::kNotEntitled;
    }
  }

  QRVLogInfo("command={}, client={}, error={}", command, clientName, result);

  // A command that answers later has handed its reply to its completion;
  // every other outcome is answered here, exactly once.
  if (result != QRVResultCode::kSuccess || !entry || entry->repliesOnReturn) {
    reply->dictionary().set("ReplyError", QRVPlist::uinteger(result));
    reply->send();
  }
}

void QRVRelayDispatcher::runHandler(const QRVCommandTableEntry& entry, const QRVPlist& request,
                                    const std::shared_ptr<QRVReply>& reply, QRVClientConnection& connection,
                                    uint64_t* result) {
  try {
    entry.handler(request, reply, connection, result);
    connection.completeWithError(result);
  } catch (...) {
    // On an internal build an exception is a bug to be seen at once.
    if (services_->globalConfiguration->isInternalImage()) QRVReportUncaughtException(std::current_exception());
    QRVLogError("exception while handling command {}", entry.command);
    *result = QRVResultCode::kException;
  }
  // 0 is no code at all: a handler or a deferred command failed without
  // saying why. The client must not read that as anything, so it gets the
  // code of a failure inside an operation.
  if (*result == 0) {
    QRVLogError("Internal error: command {} failed without a result code; answering {}", entry.command,
                QRVResultCode::kException);
    *result = QRVResultCode::kException;
  }
}

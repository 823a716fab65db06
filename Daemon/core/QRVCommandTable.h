// The fixed table of the daemon's 32 commands: for each, its handler, the
// entitlement that grants it, and three constant flags.
#pragma once

#include <array>
#include <cstdint>
#include <memory>

#include "base/QRVPlist.h"
#include "platform/QRVMessageService.h"

class QRVClientConnection;

// Entitlements read by the dispatcher.
inline constexpr const char* kEntitlementAllowed = "com.kelva.private.Quorva.allowed";
inline constexpr const char* kEntitlementOtherIdLookup = "com.kelva.private.Quorva.otherIdLookup";
inline constexpr const char* kEntitlementLookup = "com.kelva.private.Quorva.lookup";
inline constexpr const char* kEntitlementUserManagedAssets = "com.kelva.private.Quorva.userManagedAssets";
inline constexpr const char* kEntitlementWipeContainer = "com.kelva.private.Quorva.wipeContainer";
inline constexpr const char* kEntitlementDeleteContainerContent = "com.kelva.private.Quorva.deleteContainerContent";
inline constexpr const char* kEntitlementDataMigration = "com.kelva.private.Quorva.dataMigration";
inline constexpr const char* kEntitlementTestability = "com.kelva.private.Quorva.testability";
inline constexpr const char* kEntitlementStageSharedContent = "com.kelva.private.Quorva.stageSharedContent";

// A handler reads its arguments from `request`, writes results into the
// reply's dictionary, does its work through `connection`, and on failure
// stores an error code through `result` (leaving it untouched on success).
// A command that answers later keeps `reply` and sends it itself.
using QRVCommandHandler = void (*)(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                   QRVClientConnection& connection, uint64_t* result);

struct QRVCommandTableEntry {
  uint64_t command;
  QRVCommandHandler handler;
  const char* entitlement;
  bool repliesOnReturn;
  bool allowedWithoutEntitlement;
  bool honoursLookupEntitlement;
};

constexpr size_t kQRVCommandCount = 32;
using QRVCommandTable = std::array<QRVCommandTableEntry, kQRVCommandCount>;

// The daemon's table. Commands whose operation is not built yet have no
// handler and answer "invalid command".
const QRVCommandTable& QRVDefaultCommandTable();

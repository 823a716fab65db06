// What a client needs to know about the daemon's request vocabulary: the
// command numbers and their names. The result codes and their texts are in
// base/QRVResultCode.h, shared with the daemon.
//
// The numbers are the wire contract and never change; the names are the
// ones the command-line client accepts and prints.
#pragma once

#include <cstdint>
#include <optional>
#include <string_view>

enum class QRVCommandNumber : uint64_t {
  createOrLookupContainer = 0,
  containersWithClass = 1,
  replaceContainer = 2,
  stageContainerForDelete = 3,
  deleteContainersOnDeathRow = 4,
  setInfoValue = 5,
  infoValueForKey = 6,
  containerMetadata = 7,
  recreateDefaultStructure = 8,
  regenerateDirectoryUUID = 9,
  deleteContainer = 10,
  wipeContainerContent = 11,
  deleteContainerContent = 12,
  createOrLookupGroupContainers = 13,
  groupContainerIdentifiersForOwner = 14,
  lookupSystemContainer = 15,
  groupContainersForOwner = 16,
  systemGroupContainerPath = 17,
  processCodeSigningInfo = 18,
  codeSigningInfoForIdentifier = 19,
  invalidateCodeSigningInfoForAppsWithoutBundleContainer = 20,
  setDataProtection = 21,
  recreateDefaultStructureAgain = 22,
  diskUsage = 23,
  performDataMigration = 24,
  retryTest = 25,
  stageSharedContent = 26,
  retiredCommand = 27,
  userManagedAssetsPath = 28,
  deleteUserManagedAsset = 29,
  performPerUserDataMigration = 30,
  setTestLock = 31,
};

namespace QRVProtocol {

constexpr uint64_t kCommandCount = 32;

// The reply key that carries the result code (a QRVResultCode).
constexpr std::string_view kReplyErrorKey = "ReplyError";
constexpr std::string_view kCommandKey = "Command";

// The command's name, or an empty view for a number outside the table.
std::string_view commandName(uint64_t command);
// The number of the command called `name` (exact, case-sensitive match).
std::optional<uint64_t> commandForName(std::string_view name);

}  // namespace QRVProtocol

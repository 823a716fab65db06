#include "client/QRVProtocol.h"

#include <array>

namespace QRVProtocol {

namespace {

// Indexed by command number.
constexpr std::array<std::string_view, kCommandCount> kCommandNames = {
    "createOrLookupContainer",
    "containersWithClass",
    "replaceContainer",
    "stageContainerForDelete",
    "deleteContainersOnDeathRow",
    "setInfoValue",
    "infoValueForKey",
    "containerMetadata",
    "recreateDefaultStructure",
    "regenerateDirectoryUUID",
    "deleteContainer",
    "wipeContainerContent",
    "deleteContainerContent",
    "createOrLookupGroupContainers",
    "groupContainerIdentifiersForOwner",
    "lookupSystemContainer",
    "groupContainersForOwner",
    "systemGroupContainerPath",
    "processCodeSigningInfo",
    "codeSigningInfoForIdentifier",
    "invalidateCodeSigningInfoForAppsWithoutBundleContainer",
    "setDataProtection",
    "recreateDefaultStructureAgain",
    "diskUsage",
    "performDataMigration",
    "retryTest",
    "stageSharedContent",
    "retiredCommand",
    "userManagedAssetsPath",
    "deleteUserManagedAsset",
    "performPerUserDataMigration",
    "setTestLock",
};

}  // namespace

std::string_view commandName(uint64_t command) {
  return command < kCommandCount ? kCommandNames[command] : std::string_view();
}

std::optional<uint64_t> commandForName(std::string_view name) {
  for (uint64_t i = 0; i < kCommandCount; i++)
    if (kCommandNames[i] == name) return i;
  return std::nullopt;
}

}  // namespace QRVProtocol

#include "client/QRVProtocol.h"

#include <array>
#include <utility>

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

constexpr std::pair<uint64_t, std::string_view> kResultCodes[] = {
    {1, "success"},
    {4, "move to /tmp failed"},
    {5, "transient container could not be removed"},
    {6, "default subdirectory not created"},
    {7, "staging directory not created"},
    {8, "container not moved live"},
    {9, "staging directory not removed"},
    {10, "path is not what was expected"},
    {11, "invalid object or argument"},
    {12, "a daemon file could not be read"},
    {14, "moving the old container aside failed"},
    {15, "moving the new container into place failed"},
    {18, "missing identifier or entitlements"},
    {21, "no such container"},
    {22, "same container"},
    {23, "different container classes"},
    {24, "info value not found"},
    {27, "destination already exists"},
    {28, "container could not be deleted"},
    {29, "file content invalid or mismatched"},
    {33, "file missing a field"},
    {34, "file not written"},
    {35, "file unreadable or rollback failed"},
    {36, "file not moved or removed"},
    {38, "invalid input"},
    {40, "exception inside the operation"},
    {41, "move to death row failed"},
    {43, "container cache failure"},
    {44, "container cache failure"},
    {45, "container cache: add failed"},
    {46, "container cache: remove failed"},
    {47, "container cache failure"},
    {49, "invalid command"},
    {55, "caller not entitled"},
    {60, "list lengths differ"},
    {61, "device locked"},
    {66, "database operation failed"},
    {67, "database entry not found"},
    {68, "database changed-row count unexpected"},
    {69, "superseded by a newer data-protection operation"},
    {73, "database row allocation failed"},
    {75, "invalid user-identity data"},
    {76, "different user identities"},
    {77, "command queue exhausted"},
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

std::string_view resultCodeDescription(uint64_t code) {
  for (const auto& [number, text] : kResultCodes)
    if (number == code) return text;
  return {};
}

}  // namespace QRVProtocol

#include "core/QRVCommandTable.h"

#include "core/QRVCodeSigningHandlers.h"
#include "core/QRVCommandHandlers.h"
#include "core/QRVContainerHandlers.h"
#include "core/QRVContentsHandlers.h"
#include "core/QRVDataProtectionHandlers.h"
#include "core/QRVDeleteHandlers.h"
#include "core/QRVGroupHandlers.h"
#include "core/QRVMigrationHandlers.h"

namespace {

constexpr bool R = true, A = true, L = true, _ = false;

// clang-format off
const QRVCommandTable kTable = {{
    // command, handler, entitlement, repliesOnReturn, allowedWithoutEntitlement, honoursLookup
    { 0, QRVHandleCreateOrLookupContainer,  kEntitlementAllowed,                R, A, L},  // createOrLookupContainer
    { 1, QRVHandleContainersWithClass,      kEntitlementAllowed,                R, _, L},  // containersWithClass
    { 2, QRVHandleReplaceContainer,         kEntitlementAllowed,                R, _, _},  // replaceContainer
    { 3, QRVHandleStageContainerForDelete,  kEntitlementAllowed,                R, _, _},  // stageContainerForDelete
    // Emptying death row is granted by the user-managed-assets right: the
    // clients that manage assets are the ones that need space back at once.
    { 4, QRVHandleDeleteContainersOnDeathRow, kEntitlementUserManagedAssets,      _, _, _},  // deleteContainersOnDeathRow
    { 5, QRVHandleSetInfoValue,             kEntitlementAllowed,                R, _, _},  // setInfoValue
    { 6, QRVHandleInfoValueForKey,          kEntitlementAllowed,                R, _, _},  // infoValueForKey
    { 7, QRVHandleContainerMetadata,        kEntitlementAllowed,                R, _, _},  // containerMetadata
    { 8, QRVHandleRecreateDefaultStructure, kEntitlementAllowed,                R, _, _},  // recreateDefaultStructure
    { 9, QRVHandleRegenerateDirectoryUUID,  kEntitlementAllowed,                R, _, _},  // regenerateDirectoryUUID
    {10, QRVHandleDeleteContainer,          kEntitlementAllowed,                R, _, _},  // deleteContainer
    {11, QRVHandleWipeContainerContent,     kEntitlementWipeContainer,          R, _, _},  // wipeContainerContent
    {12, QRVHandleDeleteContainerContent,   kEntitlementDeleteContainerContent, R, _, _},  // deleteContainerContent
    {13, QRVHandleCreateOrLookupGroupContainers, kEntitlementAllowed,                R, A, L},  // createOrLookupGroupContainers
    {14, QRVHandleGroupContainerIdentifiersForOwner, kEntitlementAllowed,                R, _, L},  // groupContainerIdentifiersForOwner
    {15, QRVHandleLookupSystemContainer, kEntitlementAllowed,                R, A, L},  // lookupSystemContainer
    {16, QRVHandleGroupContainersForOwner, kEntitlementAllowed,                R, A, L},  // groupContainersForOwner
    {17, QRVHandleSystemGroupContainerPath, kEntitlementAllowed,                R, A, L},  // systemGroupContainerPath
    {18, QRVHandleProcessCodeSigningInfo, kEntitlementAllowed,                R, _, _},  // processCodeSigningInfo
    {19, QRVHandleCodeSigningInfoForIdentifier, kEntitlementAllowed,                R, _, _},  // codeSigningInfoForIdentifier
    {20, QRVHandleInvalidateCodeSigningInfoForAppsWithoutBundleContainer, kEntitlementAllowed,                R, _, _},  // invalidateCodeSigningInfoForAppsWithoutBundleContainer
    {21, QRVHandleSetDataProtection,       kEntitlementAllowed,                _, _, _},  // setDataProtection
    {22, QRVHandleRecreateDefaultStructure, kEntitlementAllowed,                R, _, _},  // recreateDefaultStructureAgain
    {23, QRVHandleDiskUsage,                kEntitlementAllowed,                R, _, L},  // diskUsage
    {24, QRVHandlePerformDataMigration,     kEntitlementDataMigration,          R, _, _},  // performDataMigration
    {25, QRVHandleRetryTest,                kEntitlementTestability,            R, _, _},  // retryTest
    {26, QRVHandleStageSharedContent,       kEntitlementStageSharedContent,     R, _, _},  // stageSharedContent
    {27, nullptr,                           kEntitlementAllowed,                R, _, _},  // retiredCommand: always invalid
    {28, QRVHandleUserManagedAssetsPath,    kEntitlementUserManagedAssets,      R, A, _},  // userManagedAssetsPath
    {29, QRVHandleDeleteUserManagedAsset,   kEntitlementUserManagedAssets,      R, _, _},  // deleteUserManagedAsset
    {30, QRVHandlePerformPerUserDataMigration, kEntitlementAllowed,                R, _, _},  // performPerUserDataMigration
    {31, QRVHandleSetTestLock,              kEntitlementTestability,            R, _, _},  // setTestLock
}};
// clang-format on

}  // namespace

const QRVCommandTable& QRVDefaultCommandTable() { return kTable; }

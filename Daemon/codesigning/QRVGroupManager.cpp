#include "codesigning/QRVGroupManager.h"

#include <exception>

#include "base/QRVLog.h"
#include "core/QRVCommandStageForDelete.h"
#include "core/QRVLocks.h"
#include "core/QRVServices.h"
#include "model/QRVContainerCache.h"
#include "model/QRVGlobalConfiguration.h"
#include "model/QRVPerUserConfiguration.h"

QRVGroupManager::QRVGroupManager(std::weak_ptr<QRVServices> services) : services_(std::move(services)) {}

std::optional<std::vector<std::string>> QRVGroupManager::groupContainerIdentifiersForOwnerIdentifier(
    const std::optional<std::string>& ownerIdentifier, QRVContainerClass groupContainerClass, bool useLocking,
    QRVError* error) {
  if (!ownerIdentifier) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidObject, "Can't act on an invalid object: ID: {}", "(null)"));
    return std::nullopt;
  }
  std::shared_ptr<QRVServices> services = services_.lock();
  if (!services || !services->codeSigningMapping) {
    // Only during shutdown: the services are going away with the mapping.
    QRVFail(error, QRV_ERROR(QRVResultCode::kException, "No code-signing mapping to ask for the groups of {}",
                             *ownerIdentifier));
    return std::nullopt;
  }
  std::optional<QRVGlobalReadLock> lock;
  if (useLocking) lock.emplace();
  try {
    // The mapping answers with an empty list when the owner claims nothing,
    // which is an ordinary answer, not a failure.
    if (groupContainerClass == QRVContainerClassSystemGroup)
      return services->codeSigningMapping->systemGroupIdentifiersForIdentifier(*ownerIdentifier);
    return services->codeSigningMapping->appGroupIdentifiersForIdentifier(*ownerIdentifier);
  } catch (const std::exception& e) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kException, "Got exception: {} : {}", e.what(), *ownerIdentifier));
    return std::nullopt;
  }
}

void QRVGroupManager::reconcileGroupContainersOfType(QRVGroupType type, QRVCommandQueue& commandQueue) {
  std::shared_ptr<QRVServices> services = services_.lock();
  if (!services || !services->codeSigningMapping) return;
  std::optional<QRVGroupReferenceCounts> counts = services->codeSigningMapping->copyReferenceCountSetOfType(type);
  if (!counts) {
    // Without the claims nothing can be judged unclaimed: deleting on a
    // guess would lose shared data.
    QRVLogError("Failed to get reference count information for group type: {}", static_cast<uint64_t>(type));
    return;
  }
  if (type == QRVGroupTypeSystem) {
    // System groups are device-wide: they live with the default user only.
    _cleanupUnreferencedGroupContainersForUserIdentity(services->userIdentityCache->defaultUserIdentity(),
                                                       QRVContainerClassSystemGroup, *counts, commandQueue);
    return;
  }
  services->userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [&](const QRVUserIdentityRef& userIdentity) {
        // A user who never had containers has no group containers either;
        // asking the cache would create the user's class directory.
        auto perUser = services->globalConfiguration->getPerUserConfigurationForUserIdentity(userIdentity);
        if (!perUser || !perUser->existsUserBaseDirectory()) return;
        _cleanupUnreferencedGroupContainersForUserIdentity(userIdentity, QRVContainerClassAppGroup, *counts,
                                                           commandQueue);
      });
}

void QRVGroupManager::_cleanupUnreferencedGroupContainersForUserIdentity(const QRVUserIdentityRef& userIdentity,
                                                                         QRVContainerClass containerClass,
                                                                         const QRVGroupReferenceCounts& referenceCounts,
                                                                         QRVCommandQueue& commandQueue) {
  std::shared_ptr<QRVServices> services = services_.lock();
  if (!services || !userIdentity) return;
  const std::string user = userIdentity->description();
  QRVError error;
  auto containers =
      services->containerCache->allContainersForUserIdentity(userIdentity, containerClass, /*transient=*/false, &error);
  if (!containers) {
    QRVLogError("Failed to fetch group container list for {}: {}", user, error.description());
    return;
  }
  for (const QRVMetadataRef& container : *containers) {
    auto claim = referenceCounts.find(container->identifier());
    if (claim != referenceCounts.end() && claim->second > 0) continue;
    QRVLogNotice("Removing group container {} for {} at {}", container->identifier(), user, container->url());
    // One command per container, so that a failure names its group.
    std::string identifier = container->identifier();
    auto onError = [identifier, user](uint64_t code) {
      QRVLogError("Failed to destroy group container with identifier {} for {}: {}", identifier, user, code);
    };
    commandQueue.insertCommand(QRVCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
        {container->containerIdentity()}, /*useLocking=*/false, std::move(onError), services));
  }
}

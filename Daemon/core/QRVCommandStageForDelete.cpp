#include "core/QRVCommandStageForDelete.h"

#include <exception>

#include "base/QRVLog.h"
#include "base/QRVResultCode.h"
#include "core/QRVExceptionReporter.h"
#include "core/QRVLocks.h"
#include "fs/QRVDictionaryAdditions.h"
#include "model/QRVContainerCache.h"

std::shared_ptr<QRVCommandStageForDelete> QRVCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
    std::vector<QRVContainerIdentityRef> containerIdentities, bool useLocking, ErrorHandler onError,
    std::shared_ptr<QRVServices> services) {
  return std::shared_ptr<QRVCommandStageForDelete>(new QRVCommandStageForDelete(
      std::move(containerIdentities), useLocking, std::move(onError), std::move(services)));
}

bool QRVCommandStageForDelete::fromQueue(QRVCommandQueue& queue, uint64_t* result) {
  std::optional<QRVGlobalWriteLock> lock;
  if (useLocking_) lock.emplace();
  bool ok = true;
  try {
    for (const QRVContainerIdentityRef& identity : containerIdentities_) {
      if (identity && !stage(*identity, queue, result)) {
        ok = false;
        break;
      }
    }
  } catch (...) {
    QRVReportUncaughtException(std::current_exception());
  }
  if (!ok && onError_) onError_(*result);
  return ok;
}

bool QRVCommandStageForDelete::stage(const QRVContainerIdentity& identity, QRVCommandQueue& queue, uint64_t* result) {
  QRVContainerCache& cache = *services_->containerCache;
  QRVMetadataRef metadata = cache.containerForContainerIdentity(identity, nullptr);
  if (!metadata)
    metadata = cache.containerForContainerIdentity(identity, /*transient=*/true, /*updateSandbox=*/false, nullptr);
  if (!metadata) return true;  // nothing of that name to take away

  const std::string& url = metadata->url();
  std::string destination =
      QRVPathByAppendingComponent(services_->globalConfiguration->deathrowDirectory(), QRVLastPathComponent(url));
  if (QRVContainerClassIsBundle(identity.containerClass())) {
    uint64_t code = services_->codeSigning->removeCodeSigningDictionariesForIdentifierAndItsChildren(
        identity.identifier(), queue);
    if (code != QRVResultCode::kSuccess)
      QRVLogError("Failed to remove code signing info for {}: {}", identity.identifier(), code);
  }

  QRVFileManager& fm = *services_->fileManager;
  QRVError moveError;
  if (!fm.moveItemAtURL(url, destination, &moveError)) {
    QRVLogDebug("Couldn't stage for deletion from {} to {}: {}", url, destination, moveError.description());
    QRVError removeError;
    if (!fm.removeItemAtURL(url, &removeError)) {
      QRVLogError("Failed to delete container at {}: {}", url, removeError.description());
      *result = QRVResultCode::kNotDeleted;
      return false;
    }
  }

  QRVError cacheError;
  if (!cache.removeContainerForUserIdentity(identity.userIdentity(), identity.containerClass(), identity.identifier(),
                                            metadata->transient(), &cacheError)) {
    QRVLogError("Failed to remove from cache id: {}, class: {}, transient: {}", identity.identifier(),
                identity.containerClass(), metadata->transient() ? 1 : 0);
    *result = QRVResultCode::kCacheRemoveFailed;
    return false;
  }
  // The launcher must no longer find the container.
  cache.setSandboxContainerMappingForUserIdentity(identity.userIdentity(), identity.identifier(),
                                                  identity.containerClass(), std::nullopt);
  return true;
}

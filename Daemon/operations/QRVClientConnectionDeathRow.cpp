// Death row: where removed containers wait to be deleted.
#include <cerrno>

#include "base/QRVLog.h"
#include "core/QRVCrashPoints.h"
#include "fs/QRVDictionaryAdditions.h"
#include "operations/QRVClientConnection.h"

namespace {

// Deletes one item, or parks it in "/tmp" when it cannot be deleted. Shared
// by the request path and the death-row queue, which outlives requests.
bool removeItemOrMoveToTemp(QRVServices& services, const std::string& url, QRVError* error) {
  QRVFileManager& fm = *services.fileManager;
  QRVError underlying;
  if (fm.removeItemAtURL(url, &underlying)) return true;
  if (underlying.isPOSIX() && underlying.code() == ENOENT) return true;
  QRVLogDebug("Couldn't remove, so moving item to /tmp: {} : {}", url, underlying.description());
  std::string destination = services.globalConfiguration->pathUnderRoot("/tmp/") + QRVLastPathComponent(url);
  if (!fm.moveItemAtURL(url, destination, &underlying))
    return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kMoveToTmpFailed, underlying,
                                               "Failed to move dir: {} to: {}", url, destination));
  return true;
}

}  // namespace

bool QRVClientConnection::_moveItemAtURLToDeathRow(const std::string& url, bool isDir, bool startDeletionThread,
                                                   QRVError* error) {
  QRVFileManager& fm = *services_->fileManager;
  std::string deathRow = services_->globalConfiguration->deathrowDirectory();
  // A directory of its own per item: two items of one name never collide.
  QRVError underlying;
  std::optional<std::string> unique = fm.createTemporaryDirectoryInDirectoryURL(deathRow, &underlying);
  if (!unique)
    return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kDeathRowMoveFailed, underlying,
                                               "Failed to create unique directory at: {}", deathRow));
  std::string destination = *unique + "/" + QRVLastPathComponent(url);
  // Files and directories move alike on Linux; `isDir` only names the kind.
  (void)isDir;
  if (!fm.moveItemAtURL(url, destination, &underlying)) {
    if (!(underlying.isPOSIX() && underlying.code() == ENOENT))
      return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kDeathRowMoveFailed, underlying,
                                                 "Failed to move item at: {} to: {}", url, destination));
    // Nothing to sentence: leave death row as it was, so that a start with
    // nothing to delete has nothing to empty.
    fm.removeItemAtURL(*unique, nullptr);
    return true;
  }
  if (startDeletionThread) deleteContainersOnDeathRowWithCompletion(nullptr);
  return true;
}

void QRVClientConnection::deleteContainersOnDeathRowWithCompletion(std::function<void()> completion) {
  std::shared_ptr<QRVServices> services = services_;
  // The work keeps the services, not this connection, which lives for one
  // request only.
  services->asyncWithKeepAlive(services->deathRowQueue, [services, completion = std::move(completion)] {
    std::string deathRow = services->globalConfiguration->deathrowDirectory();
    QRVError error;
    std::optional<std::vector<std::string>> items =
        services->fileManager->urlsForItemsInDirectoryAtURL(deathRow, &error);
    if (!items) {
      QRVLogError("Failed to list death row at {}: {}", deathRow, error.description());
    } else {
      for (const std::string& item : *items) {
        removeItemOrMoveToTemp(*services, item, nullptr);
        QRVCrashPoint(*services, "deathrow.item-removed");
      }
    }
    if (completion) completion();
  });
}

bool QRVClientConnection::_removeItemOrMoveToTempAtURL(const std::string& url, QRVError* error) {
  return removeItemOrMoveToTemp(*services_, url, error);
}

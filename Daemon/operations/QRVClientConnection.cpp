#include "operations/QRVClientConnection.h"

#include <set>

#include "base/QRVLog.h"
#include "dataprotection/QRVDataProtectionManager.h"
#include "fs/QRVDictionaryAdditions.h"

QRVClientConnection::QRVClientConnection(std::shared_ptr<const QRVClientIdentity> clientIdentity, bool entitled,
                                         bool allowOtherIdLookup, bool unrestricted,
                                         std::optional<QRVPlist> lookup,
                                         std::optional<QRVPlist::Array> entitledWipeIdentifiers,
                                         std::shared_ptr<QRVCommandQueue> commandQueue,
                                         std::shared_ptr<QRVServices> services)
    : clientIdentity_(std::move(clientIdentity)),
      entitled_(entitled),
      allowOtherIdLookup_(allowOtherIdLookup),
      unrestricted_(unrestricted),
      lookup_(std::move(lookup)),
      entitledWipeIdentifiers_(std::move(entitledWipeIdentifiers)),
      commandQueue_(std::move(commandQueue)),
      services_(std::move(services)) {}

std::shared_ptr<QRVClientConnection> QRVClientConnection::makeSharedClientConnection(
    std::shared_ptr<QRVServices> services) {
  QRVUserIdentityRef user = services->userIdentityCache->defaultUserIdentity();
  return makePrivilegedClientConnection(std::move(user), std::move(services));
}

std::shared_ptr<QRVClientConnection> QRVClientConnection::makePrivilegedClientConnection(
    QRVUserIdentityRef userIdentity, std::shared_ptr<QRVServices> services) {
  auto identity = QRVClientIdentity::privilegedClientIdentityWithUserIdentity(std::move(userIdentity));
  return std::make_shared<QRVClientConnection>(std::move(identity), /*entitled=*/true, /*allowOtherIdLookup=*/false,
                                               /*unrestricted=*/true, std::nullopt, std::nullopt,
                                               std::make_shared<QRVCommandQueue>(), std::move(services));
}

bool QRVClientConnection::completeWithError(uint64_t* result) {
  return commandQueue_->executeAllUntilExhaustedOrError(result);
}

// The boot steps below are entry points that the container lifecycle work
// fills in; until then they say so in the log, so a reader of the log knows
// that nothing was restored or cleaned.

void QRVClientConnection::rebootQuorvaSetup() {
  QRVLogNotice("reboot set-up does nothing yet: there is no container state to restore");
}

void QRVClientConnection::quorvaSetup() {
  // An interrupted replace is finished or rolled back before any request can
  // see the containers involved.
  QRVError error;
  if (!_recoverFromReplaceOperationsWithError(&error))
    QRVLogError("Failed recovering from replace operations: {}", error.description());
  // A class change a crash interrupted is finished, so no container stays
  // half in its old class.
  if (!services_->dataProtectionManager->restartPendingDataProtectionOperationsWithError(&error))
    QRVLogError("Failed restarting pending data protection operations: {}", error.description());
}

void QRVClientConnection::rebootQuorvaCleanupWithCompletion(std::function<void()> completion) {
  services_->backgroundQueue->async([completion = std::move(completion)] {
    QRVLogNotice("reboot cleanup does nothing yet");
    if (completion) completion();
  });
}

void QRVClientConnection::quorvaCleanupWithCompletion(std::function<void()> completion) {
  // What lies in staging now was left by an earlier run: collect it here, at
  // start-up, before any request can build something new there.
  // A replace journal that recovery could not finish still names an old
  // container parked in staging, the only copy of it: such items stay. When
  // the journals cannot be read, nothing in staging is known to be spare.
  QRVFileManager& fm = *services_->fileManager;
  QRVGlobalConfiguration& config = *services_->globalConfiguration;
  std::vector<std::string> leftovers;
  std::set<std::string> named;
  const bool journalsKnown = _stagingItemsNamedByReplaceFiles(&named);
  if (!journalsKnown) QRVLogError("Leaving staging alone: the replace files left cannot all be read");
  auto collect = [&](const std::string& staging, const char* failure) {
    QRVError error;
    std::optional<std::vector<std::string>> items = fm.urlsForItemsInDirectoryAtURL(staging, &error);
    if (!items) {
      if (!(error.isPOSIX() && error.code() == ENOENT))
        QRVLogError(fmt::runtime(failure), staging, error.description());
      return;
    }
    for (const std::string& item : *items) {
      if (named.count(QRVLastPathComponent(item))) {
        QRVLogNotice("Keeping {} in staging: a replace file still names it", item);
        continue;
      }
      leftovers.push_back(item);
    }
  };
  if (journalsKnown) {
    collect(config.stagingDirectory(), "Failed to get items at global staging URL: {} : {}");
    services_->userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        [&](const QRVUserIdentityRef& user) {
          collect(config.stagingDirectoryURLForUserIdentity(user, QRVContainerClassAppData),
                  "Failed to get items at per-user staging URL: {} : {}");
        });
  }

  // The work outlives this call; it runs as the daemon's own connection.
  std::shared_ptr<QRVClientConnection> worker = makeSharedClientConnection(services_);
  services_->backgroundQueue->async(
      [worker, leftovers = std::move(leftovers), completion = std::move(completion)] {
        for (const std::string& item : leftovers) {
          QRVError error;
          if (!worker->_moveItemAtURLToDeathRow(item, /*isDir=*/true, /*startDeletionThread=*/false, &error))
            QRVLogError("Failed to move staging leftover {} to death row: {}", item, error.description());
        }
        worker->deleteContainersOnDeathRowWithCompletion(nullptr);
        if (completion) completion();
      });
}

bool QRVClientConnection::retryTestWithNumCrashes(uint64_t numCrashes, QRVError* error) {
  QRVFileManager& fm = *services_->fileManager;
  std::string directory = services_->globalConfiguration->homeDirectory() + "Library/Quorva";
  if (!fm.createDirectoryAtURL(directory, true, 0755, error)) return false;
  std::string path = directory + "/retry-test.plist";

  uint64_t crashed = 0;
  std::vector<uint8_t> bytes;
  if (fm.readFileAtURL(path, &bytes, nullptr)) {
    if (auto record = QRVPlist::fromBytes(bytes.data(), bytes.size())) crashed = record->uint64ForKey("QRVRetryTestCrashes");
  }
  if (crashed >= numCrashes) {
    QRVLogNotice("retry test done after {} crashes", crashed);
    return fm.removeFileAtURL(path, error);
  }
  QRVPlist record = QRVPlist::dictionary().set("QRVRetryTestCrashes", QRVPlist::uinteger(crashed + 1));
  if (!fm.writeFileAtomically(path, record.toBinary(), 0644, error)) return false;
  QRVLogNotice("retry test: crashing ({} of {})", crashed + 1, numCrashes);
  abort();
}

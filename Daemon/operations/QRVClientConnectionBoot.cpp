// The daemon's boot work: what a start after a device boot, and every start,
// does to bring the container tree into a consistent state before (and just
// after) the first request is served.
#include <set>

#include "base/QRVLog.h"
#include "codesigning/QRVCodeSigningMapping.h"
#include "core/QRVLocks.h"
#include "dataprotection/QRVDataProtectionManager.h"
#include "fs/QRVDictionaryAdditions.h"
#include "fs/QRVPathComponents.h"
#include "operations/QRVClientConnection.h"


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
  QRVGlobalConfiguration& config = *services_->globalConfiguration;
  QRVFileManager& fm = *services_->fileManager;
  // Transient containers live for one boot: every tree of them goes, the
  // device-wide ones first.
  auto sentence = [&](const std::string& url, const char* failure) {
    QRVError error;
    // The configuration makes these trees when it is asked for them: an
    // empty one holds no container and is left, so that a boot without
    // transient containers gives death row nothing to do.
    std::optional<std::vector<std::string>> items = fm.urlsForItemsInDirectoryAtURL(url, &error);
    if (items && items->empty()) return;
    if (!_moveItemAtURLToDeathRow(url, /*isDir=*/true, /*startDeletionThread=*/false, &error))
      QRVLogError(fmt::runtime(failure), url, error.description());
  };
  sentence(config.transientDirectory(), "Failed to delete shared transient URL {} : {}");
  const std::string legacy = config.legacyTransientBundleDirectory();
  if (fm.itemExistsAtURL(legacy)) {
    QRVLogNotice("Sentencing legacy transient bundle directory [{}] to final deletion", legacy);
    sentence(legacy, "Failed to delete legacy shared transient bundle URL {} : {}");
  }
  sentence(config.transientBundleDirectory(), "Failed to delete shared transient bundle URL {} : {}");

  // The class directories to search for orphans: every per-user class of
  // every user who has containers, and the device-wide classes once.
  std::vector<std::pair<std::string, QRVContainerClass>> classDirectories;
  auto collect = [&](const QRVUserIdentityRef& user, bool perUser) {
    for (QRVContainerClass c = QRVContainerClassAppBundle; c < QRVContainerClassMax; c++) {
      if (QRVContainerClassIsPerUser(c) != perUser) continue;
      if (std::optional<std::string> directory = config.containerDirectoryURLForUserIdentity(user, c, false))
        classDirectories.emplace_back(std::move(*directory), c);
    }
  };
  services_->userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [&](const QRVUserIdentityRef& user) {
        std::shared_ptr<QRVPerUserConfiguration> perUser = config.getPerUserConfigurationForUserIdentity(user);
        if (!perUser->existsUserBaseDirectory()) return;
        sentence(perUser->transientDirectory(), "Failed to delete per-user transient URL {} : {}");
        collect(user, /*perUser=*/true);
      });
  collect(services_->userIdentityCache->defaultUserIdentity(), /*perUser=*/false);

  std::shared_ptr<QRVClientConnection> worker = makeSharedClientConnection(services_);
  services_->backgroundQueue->async(
      [worker, classDirectories = std::move(classDirectories), completion = std::move(completion)] {
        for (const auto& [directory, containerClass] : classDirectories)
          worker->_cleanupOrphanedDataForDirectories({directory}, containerClass);
        worker->_cleanupOprhanedCodeSigningMappingData();
        if (completion) completion();
      });
}

void QRVClientConnection::_cleanupOrphanedDataForDirectories(const std::vector<std::string>& directories,
                                                             QRVContainerClass containerClass) {
  QRVFileManager& fm = *services_->fileManager;
  for (const std::string& directory : directories) {
    QRVError error;
    std::optional<std::vector<std::string>> entries = fm.urlsForItemsInDirectoryAtURL(directory, &error);
    if (!entries) {
      QRVLogError("Failed to get items : {}", error.description());
      continue;
    }
    for (const std::string& entry : *entries) {
      // Only what can be a container of this class is the daemon's to judge:
      // anything else in a class directory was put there by someone else and
      // is left alone.
      if (!services_->containerCache->containerURL(entry, containerClass)) continue;
      // Creation places a container whole, metadata included, under the
      // global write lock: holding the read lock, a directory without
      // metadata is not one being made.
      QRVGlobalReadLock lock;
      if (!fm.itemExistsAtURL(entry)) continue;
      if (fm.itemExistsAtURL(QRVPathByAppendingComponent(entry, QRVMetadata::kFileName))) continue;
      QRVLogError("Deleting orphaned data missing a metadata file at: {}", entry);
      if (services_->globalConfiguration->isInternalImage()) {
        QRVLogError("*** Orphaned container data: a container directory without its metadata file. "
                    "Its contents follow, for whoever investigates. ***");
        fm.printDirectoryStructureAtURL(entry);
      }
      if (!_moveItemAtURLToDeathRow(entry, /*isDir=*/true, /*startDeletionThread=*/false, &error))
        QRVLogError("Failed to move orphaned data at {} to death row: {}", entry, error.description());
    }
  }
}

void QRVClientConnection::_cleanupOprhanedCodeSigningMappingData() {
  if (!services_->codeSigningMapping) return;
  QRVError error;
  if (!services_->codeSigningMapping->removeAllAdvanceCopiesWithError(&error))
    QRVLogError("Could not remove advance copies of code sign data: {}", error.description());
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


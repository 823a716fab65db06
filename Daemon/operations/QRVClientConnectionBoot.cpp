// The daemon's boot work: what a start after a device boot, and every start,
// does to bring the container tree into a consistent state before (and just
// after) the first request is served.
#include <set>

#include "base/QRVLog.h"
#include "codesigning/QRVCodeSigningMapping.h"
#include "codesigning/QRVGroupManager.h"
#include "codesigning/QRVWhitelist.h"
#include "core/QRVCommandQueue.h"
#include "core/QRVCrashPoints.h"
#include "core/QRVLocks.h"
#include "dataprotection/QRVDataProtectionManager.h"
#include "fs/QRVDictionaryAdditions.h"
#include "fs/QRVPathComponents.h"
#include "migration/QRVContainerMigrator.h"
#include "migration/QRVMigrationStatus.h"
#include "operations/QRVClientConnection.h"

namespace {

// The states of a backup tree: waiting ("Data"), being restored, and the
// children that could not be restored.
const std::string kInProgress = ".inprogress";
const std::string kFailed = ".failed";

}  // namespace

void QRVClientConnection::rebootQuorvaSetup() {
  // An unreadable status (logged) tells nothing about the build: no
  // upgrade work runs on a guess.
  std::unique_ptr<QRVMigrationStatus> status = QRVMigrationStatus::initForSystemMigration(*services_);
  if (status && status->isBuildUpgrade()) {
    _regenerateAllSystemContainerPaths();
    QRVError error;
    if (!services_->containerMigrator->performSynchronousBuildUpgradeMigration(*status, &error))
      QRVLogError("Failed to perform build upgrade migration : {}", error.description());
    // Recorded even after a failure: the failed steps are not recorded and
    // run at the next upgrade, and rolling the paths again at every boot
    // meanwhile would help nobody.
    status->writeCurrentBuildInfoToDisk();
  }
  _restoreSystemContainersFromBackup();
  // On a multi-user host every user's group claims are in view only now,
  // at boot: group containers nobody claims any more go.
  QRVPersonaService* personas = services_->platform.personas.get();
  if (personas && personas->isMultiUserHost() && services_->groupManager) {
    services_->groupManager->reconcileGroupContainersOfType(QRVGroupTypeApplication, *commandQueue_);
    uint64_t result = QRVResultCode::kSuccess;
    if (!commandQueue_->executeAllUntilExhaustedOrError(&result))
      QRVLogError("Failed to delete unclaimed group containers: {}", result);
  }
}

void QRVClientConnection::_regenerateAllSystemContainerPaths() {
  QRVLogNotice("Rolling system container directory UUIDs on disk");
  const QRVUserIdentityRef& user = clientIdentity_->userIdentity();
  for (QRVContainerClass containerClass : {QRVContainerClassSystemData, QRVContainerClassSystemGroup}) {
    QRVError error;
    std::optional<std::vector<QRVMetadataRef>> containers = services_->containerCache->allContainersForUserIdentity(
        user, containerClass, /*transient=*/false, /*populateSandboxCache=*/false, &error);
    if (!containers) {
      QRVLogError("Failed to get list of system containers for migration: {}", error.description());
      continue;
    }
    for (const QRVMetadataRef& container : *containers) {
      if (container->identifier().empty()) continue;
      // The shared system group is reached by its path from every process:
      // it keeps it.
      if (containerClass == QRVContainerClassSystemGroup &&
          container->identifier() == QRVWhitelist::kSharedSystemGroupIdentifier)
        continue;
      if (!regenerateDirectoryUUIDWithContainerIdentity(container->containerIdentity(), &error))
        QRVLogError("Failed to regenerate directory UUID for identifier: {}, class: {}", container->identifier(),
                    containerClass);
      QRVCrashPoint(*services_, "boot.uuid-rolled");
    }
  }
}

void QRVClientConnection::_restoreSystemContainersFromBackup() {
  QRVFileManager& fm = *services_->fileManager;
  const QRVUserIdentityRef user = services_->userIdentityCache->defaultUserIdentity();
  std::shared_ptr<QRVPerUserConfiguration> perUser =
      services_->globalConfiguration->getPerUserConfigurationForUserIdentity(user);
  const std::string base = perUser->systemContainerBackupBaseDirectory();
  const std::string data = perUser->systemContainerBackupDirectory();
  const std::string shared = perUser->systemGroupContainerBackupDirectory();
  const std::string dataInProgress = data + kInProgress;
  const std::string sharedInProgress = shared + kInProgress;

  // A backup being restored is first renamed aside, so that a restore cut
  // short by a crash is taken up again from where it stood rather than
  // mistaken for a new backup.
  auto beginRestore = [&](const std::string& backup, const std::string& inProgress, const char* moveFailure) {
    if (!fm.itemExistsAtURL(backup)) return;
    QRVError error;
    if (!fm.removeItemAtURL(inProgress, &error))
      QRVLogError("Failed to remove existing inprogress system containers: {}", error.description());
    if (!fm.moveItemAtURL(backup, inProgress, &error)) QRVLogError(fmt::runtime(moveFailure), error.description());
  };
  beginRestore(data, dataInProgress, "Failed to move system containers to inprogress: {}");
  beginRestore(shared, sharedInProgress, "Failed to move shared system containers to inprogress: {}");
  if (!fm.itemExistsAtURL(dataInProgress) && !fm.itemExistsAtURL(sharedInProgress)) return;

  auto restoreAll = [&](const std::string& inProgress, QRVContainerClass containerClass, const char* listFailure) {
    QRVError error;
    std::optional<std::vector<std::string>> entries = fm.urlsForItemsInDirectoryAtURL(inProgress, &error);
    if (!entries) {
      QRVLogError(fmt::runtime(listFailure), inProgress, error.description());
      return;
    }
    for (const std::string& entry : *entries) _moveSystemContainerIntoPlace(entry, containerClass);
  };
  QRVLogNotice("Installing system containers");
  restoreAll(dataInProgress, QRVContainerClassSystemData, "Couldn't find any system containers at {}: {}");
  QRVLogNotice("Installing system group containers");
  restoreAll(sharedInProgress, QRVContainerClassSystemGroup, "Couldn't find any system shared containers at {}: {}");

  // Internal images keep the backup for inspection. Elsewhere it goes, but
  // for what could not be restored: that is nowhere else.
  if (!services_->globalConfiguration->isInternalImage()) {
    QRVError error;
    bool keptFailures = false;
    for (const std::string& item : fm.urlsForItemsInDirectoryAtURL(base, nullptr).value_or(std::vector<std::string>{})) {
      if (item.ends_with(kFailed)) {
        keptFailures = true;
        continue;
      }
      if (!fm.removeItemAtURL(item, &error))
        QRVLogError("Failed to remove system container base dir {}: {}", base, error.description());
    }
    if (!keptFailures && !fm.removeItemAtURL(base, &error))
      QRVLogError("Failed to remove system container base dir {}: {}", base, error.description());
  }
}

void QRVClientConnection::_moveSystemContainerIntoPlace(const std::string& entry, QRVContainerClass containerClass) {
  QRVFileManager& fm = *services_->fileManager;
  const std::string identifier = QRVLastPathComponent(entry);
  // "Data.inprogress/<identifier>" fails into "Data.failed/<identifier>".
  std::string backup = QRVPathComponents::parentDirectory(entry);
  if (backup.ends_with(kInProgress)) backup.resize(backup.size() - kInProgress.size());
  const std::string failedItems = QRVPathByAppendingComponent(backup + kFailed, identifier);
  QRVError error;
  // A backup is a tree of directories, one per container; anything else
  // (a file, a link) is not restored but kept aside.
  if (!fm.directoryExistsAtURL(entry)) {
    QRVLogError("Not a backed-up container directory: {}", entry);
    _moveFailedPathAside(entry, QRVPathComponents::parentDirectory(failedItems), identifier);
    return;
  }
  QRVContainerIdentityRef identity = QRVContainerIdentity::containerIdentityWithIdentifier(
      identifier, containerClass, *services_->userIdentityCache, &error);
  if (!identity) {
    QRVLogError("Failed to create container identity {}: {}", identifier, error.code());
    return;
  }
  QRVMetadataRef live = createOrLookupContainerWithContainerIdentity(identity, /*createIfNecessary=*/true,
                                                                     /*transient=*/false, /*useLocking=*/true, &error);
  if (!live) {
    QRVLogError("Failed to create system container {}: {}", identifier, error.code());
    return;
  }
  QRVLogNotice("Restoring container for {} at {} to {}", identifier, entry, live->url());
  std::optional<std::vector<std::string>> children = fm.urlsForItemsInDirectoryAtURL(entry, &error);
  if (!children) {
    QRVLogError("Failed to enumerate contents of restored system container {} at {}: {}", identifier, entry,
                error.description());
    return;
  }
  for (const std::string& child : *children) {
    const std::string name = QRVLastPathComponent(child);
    // The live container's own metadata is never replaced from a backup.
    if (name == QRVMetadata::kFileName) continue;
    const std::string destination = QRVPathByAppendingComponent(live->url(), name);
    if (!fm.removeItemAtURL(destination, &error)) {
      QRVLogError("Failed to remove destination {}:{}: {}", identifier, destination, error.description());
      _moveFailedPathAside(child, failedItems, name);
    } else if (!fm.moveItemAtURL(child, destination, &error)) {
      QRVLogError("Failed to move file in restored system container {}:{} to destination {}: {}", identifier, child,
                  destination, error.description());
      _moveFailedPathAside(child, failedItems, name);
    }
    QRVCrashPoint(*services_, "boot.restore-child-moved");
  }
  if (!recreateDefaultStructureWithContainerIdentity(live->containerIdentity(), &error))
    QRVLogError("Error processing restored system container {}: {}", identifier, error.code());
}

void QRVClientConnection::_moveFailedPathAside(const std::string& item, const std::string& failedItems,
                                               const std::string& name) {
  QRVFileManager& fm = *services_->fileManager;
  QRVError error;
  if (!fm.createDirectoryAtURL(failedItems, /*withIntermediateDirectories=*/true, 0777, &error)) {
    QRVLogError("Failed to create {}: {}", failedItems, error.description());
    return;
  }
  // An earlier restore may have kept aside an item of the same name: a
  // rename would replace it, or fail and leave this one in a backup that is
  // about to go. Each is kept, the later one under a numbered name.
  std::string destination = QRVPathByAppendingComponent(failedItems, name);
  for (int n = 1; !fm.itemDoesNotExistAtURL(destination); n++) {
    if (n > 1000) {
      QRVLogError("Failed to move {} to {}: no free name", item, failedItems);
      return;
    }
    destination = QRVPathByAppendingComponent(failedItems, fmt::format("{}.{}", name, n));
  }
  if (!fm.moveItemAtURL(item, destination, &error))
    QRVLogError("Failed to move {} to {}: {}", item, destination, error.description());
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


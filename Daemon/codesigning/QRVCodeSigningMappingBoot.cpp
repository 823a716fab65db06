// The code-signing mapping's start-up work: carrying older records into the
// database (each step recorded in the migration status so that it runs once),
// sweeping unclaimed groups, removing system containers nobody claims, and
// invalidating the records of applications that are gone.
#include <algorithm>
#include <cerrno>

#include "base/QRVLog.h"
#include "codesigning/QRVCodeSigningMapping.h"
#include "codesigning/QRVCodeSigningMappingSupport.h"
#include "codesigning/QRVGroupManager.h"
#include "codesigning/QRVSQLiteDB.h"
#include "core/QRVCommandQueue.h"
#include "core/QRVServices.h"
#include "migration/QRVMigrationStatus.h"
#include "model/QRVContainerCache.h"
#include "model/QRVGlobalConfiguration.h"
#include "operations/QRVClientConnection.h"
#include "users/QRVUserIdentityCache.h"

using namespace QRVCodeSigningMappingSupport;

namespace {

constexpr const char* kLegacyMappingFileName = "qrv_code_signing_info.plist";
constexpr const char* kGroupContainerIDsKey = "com.kelva.Verdane.GroupContainerIDs";

}  // namespace

std::optional<std::set<std::string>> QRVCodeSigningMapping::_onQueue_identifiersWithSystemContainer() {
  QRVSQLiteDB* db = _onQueue_db();
  if (!db) return std::nullopt;
  std::set<std::string> identifiers;
  std::optional<QRVError> error = db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
      [&](const std::string& identifier, const std::shared_ptr<const QRVCodeSigningEntry>& entry) {
        if (!claimsSystemContainer(entitlementsFromEntry(entry.get()))) return;
        QRVLogDebug("System container exists for identifier {}", identifier);
        identifiers.insert(identifier);
      });
  if (error) {
    QRVLogError("Failed to enumerate code signing info: {}", error->description());
    return std::nullopt;
  }
  return identifiers;
}

void QRVCodeSigningMapping::_reconcileSystemContainersWithCommandQueue(QRVCommandQueue& commandQueue) {
  std::optional<std::set<std::string>> claimed;
  queue_->sync([&] { claimed = _onQueue_identifiersWithSystemContainer(); });
  if (!claimed) {
    // An unreadable database claims nothing; deleting on that basis would
    // take every system container with it.
    QRVLogError("Not reconciling system containers: the code signing database cannot be read");
    return;
  }
  std::shared_ptr<QRVServices> services = _services();
  if (!services) return;
  QRVError error;
  auto containers = services->containerCache->allContainersForUserIdentity(
      services->userIdentityCache->defaultUserIdentity(), QRVContainerClassSystemData, /*transient=*/false, &error);
  if (!containers) {
    QRVLogError("Failed to fetch system container list: {}", error.description());
    return;
  }
  for (const QRVMetadataRef& metadata : *containers) {
    const std::string identifier = metadata->identifier();
    if (claimed->count(identifier)) continue;
    QRVLogNotice("Removing system container {} at {}: no identifier claims it", identifier, metadata->url());
    _queueStageForDelete(
        metadata->containerIdentity(),
        [identifier](uint64_t code) {
          QRVLogError("Failed to destroy system container with identifier {}: {}", identifier, code);
        },
        commandQueue);
  }
}

void QRVCodeSigningMapping::_onQueue_migrateFromMappingFileToDBIfNecessary(QRVSQLiteDB& db) {
  std::shared_ptr<QRVServices> services = _services();
  if (!services) return;
  const std::string path = services->globalConfiguration->libraryDirectory() + "/" + kLegacyMappingFileName;
  std::vector<uint8_t> bytes;
  QRVError error;
  if (!services->fileManager->readFileAtURL(path, &bytes, &error)) {
    if (!(error.isPOSIX() && error.code() == ENOENT))
      QRVLogError("Failed to read code signing mapping file at {} : {}", path, error.description());
    return;
  }
  std::optional<QRVPlist> mapping = QRVPlist::fromBytes(bytes.data(), bytes.size());
  if (!mapping || !mapping->isDictionary()) {
    // Kept where it is: a later release may be able to read it.
    QRVLogError("Failed to read code signing mapping file at {} : {}", path, "not a property-list dictionary");
    return;
  }
  QRVLogNotice("Migrating code signing info from file to DB");
  int migrated = 0;
  int failed = 0;
  for (const auto& [identifier, serialized] : mapping->dictionaryValue()) {
    QRVCodeSigningEntry entry = QRVCodeSigningEntry::initWithSerializedDictionary(serialized);
    QRVError addError;
    if (entry.hasCodeSigningInfo() && db.addCodeSigningEntry(&entry, identifier, &addError)) {
      migrated++;
    } else {
      QRVLogError("Failed to migrate code signing entry for {} : {}", identifier,
                  entry.hasCodeSigningInfo() ? addError.description() : std::string("no code signing info"));
      failed++;
    }
  }
  QRVLogNotice("Successfully migrated {} entries, failed to migrate {}", migrated, failed);
  QRVError removeError;
  if (!services->fileManager->removeFileAtURL(path, &removeError))
    QRVLogError("Failed to remove legacy code signing mapping file: {}", removeError.description());
}

// The entitlements file of older releases, in the library directory: a
// dictionary holding, under each of three keys, a dictionary keyed by
// identifier: "com.kelva.Quorva.ChildPluginBundleIDs" (parent -> array of
// child identifiers), "com.kelva.Quorva.EntitlementsRegisteredByCaller"
// and "com.kelva.Quorva.PlaceholderEntitlements" (identifier ->
// entitlements). What the database already holds wins over the file.
void QRVCodeSigningMapping::_onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile() {
  std::shared_ptr<QRVServices> services = _services();
  if (!services) return;
  const std::string path = services->globalConfiguration->libraryDirectory() + "/qrv_entitlements.plist";
  std::vector<uint8_t> bytes;
  QRVError error;
  if (!services->fileManager->readFileAtURL(path, &bytes, &error)) {
    if (!(error.isPOSIX() && error.code() == ENOENT))
      QRVLogError("Entitlement File exists at {}, but we unexpectedly cant read it", path);
    return;
  }
  std::optional<QRVPlist> legacy = QRVPlist::fromBytes(bytes.data(), bytes.size());
  if (!legacy || !legacy->isDictionary()) {
    QRVLogError("Entitlement File exists at {}, but we unexpectedly cant read it", path);
    return;
  }
  QRVSQLiteDB* db = _onQueue_db();
  if (!db) return;  // the file stays for the next boot
  QRVLogNotice("Performing legacy entitlement migration");

  auto addIfAbsent = [&](const std::string& identifier, const QRVPlist& entitlements, bool registeredByCaller,
                         bool placeholder) {
    if (!entitlements.isDictionary()) return;
    QRVError readError;
    if (db->codeSigningEntryWithIdentifier(identifier, &readError) || !isNotFound(readError)) return;
    QRVPlist info = QRVPlist::dictionary();
    info.set(kQRVCodeSigningEntitlementsKey, entitlements);
    QRVCodeSigningEntry entry(info);
    entry.setRegisteredByCaller(registeredByCaller);
    entry.setPlaceholder(placeholder);
    QRVError addError;
    if (db->addCodeSigningEntry(&entry, identifier, &addError))
      _onQueue_countWrite(identifier, nullptr, &entry);
    else
      QRVLogError("Failed to migrate code signing entry for {} : {}", identifier, addError.description());
  };
  const QRVPlist* registered = legacy->get("com.kelva.Quorva.EntitlementsRegisteredByCaller");
  if (registered && registered->isDictionary())
    for (const auto& [identifier, entitlements] : registered->dictionaryValue())
      addIfAbsent(identifier, entitlements, /*registeredByCaller=*/true, /*placeholder=*/false);
  const QRVPlist* placeholders = legacy->get(kQRVPlaceholderOption);
  if (placeholders && placeholders->isDictionary())
    for (const auto& [identifier, entitlements] : placeholders->dictionaryValue())
      addIfAbsent(identifier, entitlements, /*registeredByCaller=*/false, /*placeholder=*/true);
  const QRVPlist* children = legacy->get("com.kelva.Quorva.ChildPluginBundleIDs");
  if (children && children->isDictionary()) {
    for (const auto& [parent, list] : children->dictionaryValue()) {
      std::shared_ptr<const QRVCodeSigningEntry> stored = db->codeSigningEntryWithIdentifier(parent, nullptr);
      if (!stored || !list.isArray()) continue;
      QRVCodeSigningEntry entry = *stored;
      QRVCodeSigningEntry::ChildIdentifiers ids =
          entry.childBundleIdentifiers().value_or(QRVCodeSigningEntry::ChildIdentifiers());
      for (const QRVPlist& child : list.arrayValue()) {
        if (child.isString() && child.stringValue() != parent &&
            std::find(ids.begin(), ids.end(), child.stringValue()) == ids.end())
          ids.push_back(child.stringValue());
      }
      entry.setChildBundleIdentifiers(ids);
      QRVError addError;
      if (entry != *stored && !db->addCodeSigningEntry(&entry, parent, &addError))
        QRVLogError("Failed to migrate code signing entry for {} : {}", parent, addError.description());
    }
  }
  QRVError removeError;
  if (!services->fileManager->removeFileAtURL(path, &removeError))
    QRVLogError("Failed to remove legacy file at {}: {}", path, removeError.description());
  QRVLogNotice("Legacy entitlement migration completed");
}

// Older releases kept each data container's application groups in its
// metadata. They are carried into the database as a placeholder entry, which
// keeps the groups claimed (and hidden from external requesters) until the
// installer hands over the real information; an identifier that already has
// an entry keeps it. The value is then cleared from the container.
void QRVCodeSigningMapping::_migrateAppGroupIdsFromDataContainers() {
  std::shared_ptr<QRVServices> services = _services();
  if (!services) return;
  std::unique_ptr<QRVMigrationStatus> status = QRVMigrationStatus::initForSystemMigration(*services);
  if (!status || status->hasMigrationOccurredForType(QRVMigrationStatus::kGroupIdMigration)) return;
  QRVLogNotice("Performing group ID migration");
  QRVUserIdentityRef user = services->userIdentityCache->userIdentityForPersonalPersonaWithUID(501, 501);
  std::shared_ptr<QRVClientConnection> connection = QRVClientConnection::makeSharedClientConnection(services);
  const QRVPlist key = QRVPlist::string(kGroupContainerIDsKey);
  for (QRVContainerClass dataClass :
       {QRVContainerClassAppData, QRVContainerClassPluginData, QRVContainerClassVPNPluginData}) {
    QRVError error;
    auto containers = services->containerCache->allContainersForUserIdentity(user, dataClass, false, &error);
    if (!containers) {
      QRVLogError("Failed to fetch list of containers for userId: 501, class {} : {}", static_cast<long>(dataClass),
                  error.description());
      continue;
    }
    for (const QRVMetadataRef& metadata : *containers) {
      const QRVPlist* ids = metadata->info().isDictionary() ? metadata->info().get(kGroupContainerIDsKey) : nullptr;
      if (!ids) continue;
      const std::string identifier = metadata->identifier();
      QRVPlist groups = QRVPlist::dictionary();
      groups.set(kQRVApplicationGroupsEntitlement, *ids);
      queue_->sync([&] {
        QRVSQLiteDB* db = _onQueue_db();
        if (!db) return;
        QRVError readError;
        if (db->codeSigningEntryWithIdentifier(identifier, &readError) || !isNotFound(readError)) return;
        QRVPlist wrapped = QRVPlist::dictionary();
        wrapped.set(kQRVCodeSigningEntitlementsKey, groups);
        QRVCodeSigningEntry entry(wrapped, dataClass);
        entry.setPlaceholder(true);
        QRVError addError;
        if (db->addCodeSigningEntry(&entry, identifier, &addError))
          _onQueue_countWrite(identifier, nullptr, &entry);
        else
          QRVLogError("Failed to migrate code signing entry for {} : {}", identifier, addError.description());
      });
      QRVError clearError;
      if (!connection->removeInfoValueForKey(key, metadata->containerIdentity(), /*useLocking=*/true, &clearError))
        QRVLogError("Failed to clear group id metadata for {} : {}", identifier, clearError.resultCode());
    }
  }
  status->setMigrationCompleteForType(QRVMigrationStatus::kGroupIdMigration);
}

// Older releases cached each bundle's code-signing information in the bundle
// container's metadata. The database takes it over unless it already has an
// entry, and the cached copy is removed either way.
void QRVCodeSigningMapping::_migrateCachedCodeSigningInfoFromBundleContainersToMapping() {
  std::shared_ptr<QRVServices> services = _services();
  if (!services) return;
  std::unique_ptr<QRVMigrationStatus> status = QRVMigrationStatus::initForSystemMigration(*services);
  if (!status || status->hasMigrationOccurredForType(QRVMigrationStatus::kCodeSigningMigration)) return;
  std::shared_ptr<QRVClientConnection> connection = QRVClientConnection::makeSharedClientConnection(services);
  const QRVPlist key = QRVPlist::string(kCachedCodeSigningInfoKey);
  bool complete = true;
  for (QRVContainerClass bundleClass :
       {QRVContainerClassAppBundle, QRVContainerClassPluginBundle, QRVContainerClassVPNPluginBundle}) {
    QRVError error;
    auto containers = services->containerCache->allContainersForUserIdentity(
        services->userIdentityCache->defaultUserIdentity(), bundleClass, false, &error);
    if (!containers) {
      QRVLogError("Failed to fetch list of bundle containers of class {} : {}", static_cast<long>(bundleClass),
                  error.description());
      complete = false;
      continue;
    }
    for (const QRVMetadataRef& metadata : *containers) {
      const QRVPlist* cached =
          metadata->info().isDictionary() ? metadata->info().get(kCachedCodeSigningInfoKey) : nullptr;
      if (!cached) continue;
      const std::string identifier = metadata->identifier();
      bool stored = false;
      queue_->sync([&] {
        QRVSQLiteDB* db = _onQueue_db();
        if (!db) return;
        QRVError readError;
        if (db->codeSigningEntryWithIdentifier(identifier, &readError) || !isNotFound(readError)) {
          QRVLogNotice("Deleting cached code signing info for {} because we already have it in mapping", identifier);
          stored = true;
          return;
        }
        if (!cached->isDictionary()) return;
        QRVLogNotice("Migrating code signing info for {}", identifier);
        QRVPlist copy = *cached;
        if (const QRVPlist* e = cached->get(kCachedEntitlementsKey)) copy.set(kQRVCodeSigningEntitlementsKey, *e);
        QRVCodeSigningEntry entry(copy, QRVContainerClassAppData);
        QRVError addError;
        stored = db->addCodeSigningEntry(&entry, identifier, &addError);
        if (stored) _onQueue_countWrite(identifier, nullptr, &entry);
        if (!stored)
          QRVLogError("Failed to migrate code signing entry for {} : {}", identifier, addError.description());
      });
      // Removed only once the database holds the information.
      if (!stored) {
        complete = false;
        continue;
      }
      QRVError clearError;
      if (!connection->removeInfoValueForKey(key, metadata->containerIdentity(), /*useLocking=*/true, &clearError))
        QRVLogError("Failed to clear cached code signing info for {} : {}", identifier, clearError.resultCode());
    }
  }
  if (complete) status->setMigrationCompleteForType(QRVMigrationStatus::kCodeSigningMigration);
}

void QRVCodeSigningMapping::performAllCodeSigningMigrationAndReconciliationWithCommandQueue(
    QRVCommandQueue& commandQueue) {
  std::shared_ptr<QRVServices> services = _services();
  if (!services) return;
  // On a multi-user host other users' claims are not all in view, so
  // nothing that decides by claims alone runs there.
  const bool multiUser = services->platform.personas && services->platform.personas->isMultiUserHost();
  if (!multiUser) _migrateAppGroupIdsFromDataContainers();
  queue_->sync([&] { _onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile(); });
  _migrateCachedCodeSigningInfoFromBundleContainersToMapping();
  if (!multiUser && services->groupManager)
    services->groupManager->reconcileGroupContainersOfType(QRVGroupTypeApplication, commandQueue);
  _reconcileSystemContainersWithCommandQueue(commandQueue);
}

uint64_t QRVCodeSigningMapping::invalidateCodeSigningInfoForAppsWithoutBundleContainer() {
  struct Candidate {
    std::string identifier;
    bool isPlugin;
  };
  // The decisions that need only the database, on the queue; the container
  // look-ups after leaving it.
  std::vector<Candidate> candidates;
  queue_->sync([&] {
    QRVSQLiteDB* db = _onQueue_db();
    if (!db) return;
    auto identifiers = db->identifiersWithError(nullptr);
    if (!identifiers) return;
    for (const std::string& identifier : *identifiers) {
      std::shared_ptr<const QRVCodeSigningEntry> entry = db->codeSigningEntryWithIdentifier(identifier, nullptr);
      if (!entry) continue;
      const uint64_t dataClass = entry->dataContainerClass();
      const bool isPlugin = dataClass >= QRVContainerClassPluginBundle && dataClass <= QRVContainerClassVPNPluginData;
      const bool hasParent = isPlugin && _onQueue_parent(identifier).has_value();
      QRVLogDebug(
          "Checking for invalidation: identifier = {}, codeSigningEntry = <{}>, isRegisteredByCaller = {}, isPlugIn = "
          "{}, hasParent = {}",
          identifier, fmt::ptr(entry.get()), entry->isRegisteredByCaller() ? 1 : 0, isPlugin ? 1 : 0,
          hasParent ? 1 : 0);
      if (entry->isRegisteredByCaller() || hasParent) continue;
      candidates.push_back({identifier, isPlugin});
    }
  });

  std::shared_ptr<QRVServices> services = _services();
  if (!services) return QRVResultCode::kSuccess;
  uint64_t result = QRVResultCode::kSuccess;
  for (const Candidate& candidate : candidates) {
    bool found = false;
    for (QRVContainerClass bundleClass :
         {QRVContainerClassAppBundle, QRVContainerClassPluginBundle, QRVContainerClassVPNPluginBundle}) {
      QRVContainerIdentityRef identity = QRVContainerIdentity::containerIdentityWithIdentifier(
          candidate.identifier, bundleClass, *services->userIdentityCache, nullptr);
      if (identity && services->containerCache->containerForContainerIdentity(*identity, nullptr)) {
        found = true;
        break;
      }
    }
    if (found) continue;
    QRVLogNotice("Invalidating: identifier = {}, isPlugin = {}", candidate.identifier, candidate.isPlugin ? 1 : 0);
    if (invalidateCodeSigningInfoForIdentifierAndItsChildren(candidate.identifier) != QRVResultCode::kSuccess)
      result = QRVResultCode::kDatabaseFailed;
  }
  return result;
}

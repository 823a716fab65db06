// The daemon's single authority on what each identifier is entitled to.
//
// It records the code-signing information the installer hands over when an
// application or plug-in is installed, updated or removed, and entitlements
// a client registers for itself; it answers who a plug-in's parent is, which
// application and system groups an identifier claims, whether it has a
// system container and which class its data container has. Whenever an
// identifier's claims change it works out which group and system containers
// lost their last claimant and queues their deletion.
//
// Everything is stored in the code-signing database, which this class alone
// touches, and only from its serial queue "com.kelva.Quorva.EntitlementQueue".
// The database is opened on first use: when that fails ("Failed to
// initialize database.") the mapping answers as if it knew nothing and the
// next use tries again, so a damaged database never keeps the daemon from
// serving containers.
//
// Lock order. The container cache calls this class (plug-in parents) while it
// holds its own lock, so nothing running on the mapping's queue may ever call
// the container cache, the identifier locks or a container operation: every
// container look-up happens before entering the queue or after leaving it.
// Deletions are never performed here; they are queued as stage-for-delete
// commands on the caller's command queue and run later under the identifier
// locks.
//
// Numeric results are the daemon's result codes, 1 meaning success. Codes of
// this component: kMissingIdentifier (18) for a missing identifier or
// entitlements, kException (40), kListLengthsDiffer (60), kDatabaseFailed
// (66), and the database's codes passed through.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "base/QRVError.h"
#include "base/QRVPlist.h"
#include "base/QRVSerialQueue.h"
#include "codesigning/QRVCodeSigningEntry.h"
#include "model/QRVContainerCacheSeams.h"
#include "model/QRVContainerIdentity.h"
#include "operations/QRVContainerOperationSeams.h"

class QRVCommandQueue;
class QRVSQLiteDB;
struct QRVServices;

// Keys of the code-signing dictionary, the entitlements and the options.
inline constexpr const char* kQRVCodeSigningEntitlementsKey = "com.kelva.Quorva.Entitlements";
inline constexpr const char* kQRVApplicationGroupsEntitlement = "com.kelva.security.application-groups";
inline constexpr const char* kQRVSystemGroupsEntitlement = "com.kelva.security.system-groups";
inline constexpr const char* kQRVSystemGroupContainersEntitlement = "com.kelva.security.system-group-containers";
inline constexpr const char* kQRVSystemContainerEntitlement = "com.kelva.security.system-container";
inline constexpr const char* kQRVDataContainerClassOption = "com.kelva.Quorva.DataContainerClass";
inline constexpr const char* kQRVParentBundleIDOption = "com.kelva.Quorva.ParentBundleID";
inline constexpr const char* kQRVRegisteredByCallerOption = "RegByCaller";
inline constexpr const char* kQRVPlaceholderOption = "com.kelva.Quorva.PlaceholderEntitlements";
inline constexpr const char* kQRVAdvanceCopyOption = "com.kelva.Quorva.AdvanceCopy";
inline constexpr const char* kQRVSystemGroupPrefix = "systemgroup.";

// Group types of the counted sets.
enum QRVGroupType : uint64_t {
  QRVGroupTypeApplication = 0,  // container class 7
  QRVGroupTypeSystem = 1,       // container class 13
};

// A multiset of group identifiers: how many database entries claim each.
using QRVGroupReferenceCounts = std::map<std::string, int64_t>;

class QRVCodeSigningMapping : public QRVCodeSigningQueries,
                              public QRVSystemGroupQueries,
                              public QRVPluginParentResolver {
 public:
  // `services` gives the user identity cache, the global configuration (the
  // database lives in its library directory), the file manager, the
  // container cache and what the stage-for-delete commands need; it is held
  // weakly because the services own the mapping.
  QRVCodeSigningMapping(std::weak_ptr<QRVServices> services);
  ~QRVCodeSigningMapping() override;

  // The queue that owns every database access.
  const std::shared_ptr<QRVSerialQueue>& queue() const { return queue_; }

  // ---- Installer information ----

  // Stores (or, with `codeSigningInfo` none, removes) the identifier's entry
  // and reconciles its group and system-container claims first: lost claims
  // queue stage-for-delete commands on `commandQueue`. `options` may be none.
  uint64_t processCodeSigningInfo(const QRVPlist& codeSigningInfo, const std::optional<std::string>& identifier,
                                  const QRVPlist& options, QRVCommandQueue& commandQueue);
  // Entitlements a client registers for itself; never overwrites what an
  // installed code signature supplied.
  uint64_t processCallerRegisteredEntitlements(const QRVPlist& entitlements,
                                               const std::optional<std::string>& identifier,
                                               QRVCommandQueue& commandQueue);

  // ---- Queries ----

  // The identifier's entitlements (internal view: placeholders, advance
  // copies and invalid entries count), falling back to the copy cached in
  // its bundle container's metadata; none when there are none.
  std::optional<QRVPlist> entitlementsForIdentifier(const std::string& identifier);
  // The code-signing dictionary for an external requester: none for a
  // placeholder, an advance copy or an invalid entry.
  std::optional<QRVPlist> getCodeSigningInfoForIdentifier(const std::string& identifier);
  std::shared_ptr<const QRVCodeSigningEntry> codeSigningEntryForIdentifier(const std::string& identifier,
                                                                          QRVError* error);
  // The application groups the identifier's current entitlements claim
  // (empty when none); the system groups are the seam method below.
  std::vector<std::string> appGroupIdentifiersForIdentifier(const std::string& identifier);
  uint64_t dataContainerTypeForIdentifier(const std::string& identifier);
  bool identifierHasCallerRegisteredEntitlements(const std::string& identifier);
  std::optional<std::vector<std::string>> childBundleIdentifiersForParentIdentifier(const std::string& parent);
  std::optional<std::vector<std::string>> identifiersWithError(QRVError* error);
  // How many entries claim each group of `type`; none when the database
  // cannot be walked.
  std::optional<QRVGroupReferenceCounts> copyReferenceCountSetOfType(QRVGroupType type);
  // Drops the kept counts, so that the next call walks the database: tests
  // compare the kept counts with a fresh walk.
  void TEST_forgetReferenceCounts();

  // ---- Seams the container operations and the cache use ----
  bool identifierHasSystemContainer(const std::string& identifier) override;
  std::vector<std::string> systemGroupIdentifiersForIdentifier(const std::string& identifier) override;
  std::optional<std::string> parentIdentifierForChildIdentifier(const std::string& childIdentifier) override;
  uint64_t removeCodeSigningDictionariesForIdentifierAndItsChildren(const std::string& identifier,
                                                                   QRVCommandQueue& commandQueue) override;
  uint64_t invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string& identifier) override;

  // ---- Maintenance ----
  bool invalidateCodeSigningInfoForIdentifier(const std::string& identifier, QRVError* error);
  bool removeAllAdvanceCopiesWithError(QRVError* error);
  // Invalidates the entries of applications whose bundle container is gone.
  uint64_t invalidateCodeSigningInfoForAppsWithoutBundleContainer();
  // Boot: the legacy migrations (each recorded in the migration status so
  // it runs once), the application-group sweep (unless multi-user) and the
  // system-container reconciliation.
  void performAllCodeSigningMigrationAndReconciliationWithCommandQueue(QRVCommandQueue& commandQueue);

 private:
  // A group list as read from entitlements: none when the entitlement is
  // absent or unusable, otherwise de-duplicated and sorted.
  using GroupList = std::optional<std::vector<std::string>>;
  // The options of processCodeSigningInfo once their types are checked.
  struct Options {
    uint64_t dataContainerClass = 0;
    std::optional<std::string> parentIdentifier;
    bool registeredByCaller = false;
    bool placeholder = false;
    bool advanceCopy = false;
  };
  static Options _parseOptions(const QRVPlist& options, const std::string& identifier);

  std::shared_ptr<QRVServices> _services() const { return services_.lock(); }

  // Everything named _onQueue_ runs on queue_ only. The database, opened
  // on first use; null (logged) when it cannot be opened.
  QRVSQLiteDB* _onQueue_db();
  void _onQueue_migrateFromMappingFileToDBIfNecessary(QRVSQLiteDB& db);
  // The stored entry; null with 67 when none is stored or the database is
  // unavailable, another code when it cannot be read.
  std::shared_ptr<const QRVCodeSigningEntry> _onQueue_entry(const std::string& identifier, QRVError* error);
  std::optional<std::string> _onQueue_parent(const std::string& childIdentifier);
  std::optional<std::vector<std::string>> _onQueue_children(const std::string& parent);
  // Whether making `childIdentifier` a child of `parentIdentifier` would
  // close a loop of parents.
  bool _onQueue_wouldFormCycle(const std::string& childIdentifier, const std::string& parentIdentifier);

  uint64_t _onQueue_processCodeSigningInfo(const QRVPlist& codeSigningInfo, const std::string& identifier,
                                           const Options& options, const std::optional<QRVPlist>& oldEntitlements,
                                           QRVCommandQueue& commandQueue);
  void _onQueue_handleChangeFromOldGroupContainerIds(const GroupList& oldIds, const GroupList& newIds,
                                                     QRVGroupType type, QRVCommandQueue& commandQueue);
  void _onQueue_removeReferenceForGroupIdentifiers(const std::vector<std::string>& groupIdentifiers, QRVGroupType type,
                                                   QRVCommandQueue& commandQueue);
  // The counted set of a type: kept current by every write below, built by
  // one walk of the database when first needed (or after a write whose
  // effect on the claims is not followed one by one).
  std::optional<QRVGroupReferenceCounts> _onQueue_copyReferenceCountSetOfType(QRVGroupType type);
  // The groups of `type` that one stored entry claims, as the counts see
  // them; none when it claims none.
  static GroupList _claimedGroups(const std::string& identifier, const QRVCodeSigningEntry* entry, QRVGroupType type);
  // After `identifier`'s entry went from `before` to `after` in the
  // database (either may be null: none stored).
  void _onQueue_countWrite(const std::string& identifier, const QRVCodeSigningEntry* before,
                           const QRVCodeSigningEntry* after);
  // After a write the counts do not follow: they are walked again at the
  // next need.
  void _onQueue_forgetReferenceCounts();
  // Writes (or, for an entry without a dictionary, deletes) each entry under
  // the identifier at the same position; the first failure is returned
  // after the rest have been tried.
  std::optional<QRVError> _onQueue_setCodeSigningDictionaryValues(const std::vector<QRVCodeSigningEntry>& entries,
                                                                  const std::vector<std::string>& identifiers);
  // The identifiers whose entitlements claim a system container; none when
  // the database cannot be walked.
  std::optional<std::set<std::string>> _onQueue_identifiersWithSystemContainer();
  void _onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile();

  // Outside the queue: they look containers up.
  std::optional<QRVPlist> _entitlementsFromBundleContainer(const std::string& identifier);
  void _reconcileSystemContainersWithCommandQueue(QRVCommandQueue& commandQueue);
  void _migrateAppGroupIdsFromDataContainers();
  void _migrateCachedCodeSigningInfoFromBundleContainersToMapping();
  void _queueStageForDelete(QRVContainerIdentityRef identity, std::function<void(uint64_t)> onError,
                            QRVCommandQueue& commandQueue);

  std::weak_ptr<QRVServices> services_;
  std::shared_ptr<QRVSerialQueue> queue_;
  std::unique_ptr<QRVSQLiteDB> db_;  // opened on first use; on queue_ only
  // Counted sets by group type, on queue_ only. A change of one identifier
  // must not read every row of the database (the counts decide whether it
  // was a group's last claimant), so they are kept beside it.
  std::optional<QRVGroupReferenceCounts> referenceCounts_[2];
};

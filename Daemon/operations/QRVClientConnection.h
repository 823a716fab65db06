// The per-request view of a client: who it is, what it may do, and the
// request's command queue. The container operations are methods of this
// class, so each one sees the caller's powers.
//
// A connection lives for one request, except the daemon's own shared
// connection (privileged, unrestricted), which serves boot set-up and
// cleanup for the life of the process.
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <vector>

#include "base/QRVMutex.h"
#include "base/QRVPlist.h"
#include "core/QRVClientIdentity.h"
#include "core/QRVCommandQueue.h"
#include "core/QRVServices.h"
#include "model/QRVContainerIdentity.h"
#include "model/QRVMetadata.h"

class QRVClientConnection {
 public:
  QRVClientConnection(std::shared_ptr<const QRVClientIdentity> clientIdentity, bool entitled,
                      bool allowOtherIdLookup, bool unrestricted, std::optional<QRVPlist> lookup,
                      std::optional<QRVPlist::Array> entitledWipeIdentifiers,
                      std::shared_ptr<QRVCommandQueue> commandQueue, std::shared_ptr<QRVServices> services);

  // The daemon's own privileged connection: anonymous privileged identity,
  // its own command queue, entitled and unrestricted, no lookup for other
  // identifiers.
  static std::shared_ptr<QRVClientConnection> makeSharedClientConnection(std::shared_ptr<QRVServices> services);
  // The same, acting for `userIdentity` rather than the default user.
  static std::shared_ptr<QRVClientConnection> makePrivilegedClientConnection(QRVUserIdentityRef userIdentity,
                                                                            std::shared_ptr<QRVServices> services);

  const std::shared_ptr<const QRVClientIdentity>& clientIdentity() const { return clientIdentity_; }
  bool isEntitled() const { return entitled_; }
  bool allowOtherIdLookup() const { return allowOtherIdLookup_; }
  bool allowGroupIdLookup() const { return allowGroupIdLookup_; }
  bool isUnrestricted() const { return unrestricted_; }
  const std::optional<QRVPlist>& lookup() const { return lookup_; }
  const std::optional<QRVPlist::Array>& entitledWipeIdentifiers() const { return entitledWipeIdentifiers_; }
  QRVCommandQueue& commandQueue() { return *commandQueue_; }
  QRVServices& services() { return *services_; }

  // Handlers widen a connection for one request.
  void setUnrestricted(bool v) { unrestricted_ = v; }
  void setAllowOtherIdLookup(bool v) { allowOtherIdLookup_ = v; }
  void setAllowGroupIdLookup(bool v) { allowGroupIdLookup_ = v; }

  // Drains the command queue; the first failing command's code is stored
  // through `result`.
  bool completeWithError(uint64_t* result);

  // ---- Create and look up ----

  // The metadata of the container named by `containerIdentity`, creating
  // it (in staging, then moved live in one rename) when `createIfNecessary`.
  // A transient request always yields a fresh, empty container. With
  // `useLocking` the global read lock guards a look-up and the global write
  // lock a creation; without it the caller holds what is needed. Codes: 5,
  // 6, 7, 8, 9, 21 (not found, not logged), 38, 40, 45, 55, and those of the
  // components that pass through.
  QRVMetadataRef createOrLookupContainerWithContainerIdentity(const QRVContainerIdentityRef& containerIdentity,
                                                              bool createIfNecessary, bool transient,
                                                              bool useLocking, QRVError* error);
  // Looks up without creating. For a concrete identity the container must
  // also have that UUID.
  QRVMetadataRef metadataWithContainerIdentity(const QRVContainerIdentityRef& containerIdentity, QRVError* error);
  // Every live (or transient) container of a class for the caller's user
  // identity.
  std::optional<std::vector<QRVMetadataRef>> containersWithClass(QRVContainerClass containerClass, bool transient,
                                                                 QRVError* error);
  // Creates the container's default subdirectories again (and, for system
  // containers, restores their ACLs).
  bool recreateDefaultStructureWithContainerIdentity(const QRVContainerIdentityRef& containerIdentity,
                                                     QRVError* error);

  // ---- Group containers ----

  // The group containers `ownerIdentifier` claims (application groups for
  // class 7, system groups for class 13), keyed by group identifier, each
  // created when missing. The caller must be the owner, may look up other
  // identifiers, be unrestricted, hold a lookup entitlement for the class and
  // owner, or be whitelisted for it (55 otherwise). Allows the caller group
  // look-ups for the rest of the request. A group that cannot be created or
  // looked up is logged and left out; the call still succeeds. An owner that
  // claims nothing gets an empty map. Locking: a first pass under the global
  // read lock only looks up; if a group is missing, a second pass under the
  // global write lock reads the claims again and creates. Codes: 11, 40, 55.
  std::optional<std::map<std::string, QRVMetadataRef>> groupContainersForOwnerIdentifier(
      const std::optional<std::string>& ownerIdentifier, const QRVUserIdentityRef& userIdentity,
      QRVContainerClass groupContainerClass, QRVError* error);

  // Whether the caller's lookup entitlement lists `identifier` for the class.
  bool isEntitledForLookupWithClass(QRVContainerClass containerClass, const std::string& identifier);

  // ---- Death row ----
  // Removed containers are first renamed into a unique directory under the
  // death-row directory (atomic on one volume), then deleted in the
  // background. Both steps survive a crash: whatever is on death row stays
  // there until the next emptying.

  // Empties death row on the death-row queue, inside a keep-alive
  // transaction, then calls `completion` (may be empty) there.
  void deleteContainersOnDeathRowWithCompletion(std::function<void()> completion);

  // ---- Delete, replace and wipe ----
  // A replace swaps directories by renames only, and a small journal (the
  // replace-operation file, written atomically and flushed before the first
  // rename, moved to death row after the last) says where the old directory
  // is parked, so a crash at any point is finished or rolled back at the
  // next start.

  // Looks the container up (no creation) and queues a stage-for-delete
  // command for it; the deletion happens when the queue is drained.
  bool deleteContainerWithContainerIdentity(const QRVContainerIdentityRef& containerIdentity, bool transient,
                                            QRVError* error);
  // Queues one stage-for-delete command (with locking) for `identities`.
  void stageContainerIdentitiesForDelete(std::vector<QRVContainerIdentityRef> identities);
  // Puts the new container's directory in place of the old one. Codes: 10,
  // 11, 14, 15, 21, 22, 23, 27, 35, 36, 38, 40, 45, 46, 76, and 33/34 from
  // the journal.
  bool replaceContainerIdentity(const QRVContainerIdentityRef& oldIdentity,
                                const QRVContainerIdentityRef& newIdentity, bool preserveOldUUID,
                                bool startDeletionThread, QRVError* error);
  // Wipe: the data container keeps its UUID and path and comes back empty,
  // with its default structure; the old contents go to death row.
  bool deleteDataContainerContentWithContainerIdentity(const QRVContainerIdentityRef& containerIdentity,
                                                       QRVError* error);

  // ---- Contents ----
  // Work inside one existing container. Each finds the container without
  // creating it (21, "No Container with identity", when there is none; a
  // concrete identity must also match the UUID) and turns an exception into
  // 40.

  // The info value under `key` (which must be a string: 38). A missing
  // value is 24. With `useLocking` the look-up takes the global read lock.
  std::optional<QRVPlist> infoValueForKey(const QRVPlist& key, const QRVContainerIdentityRef& containerIdentity,
                                          bool useLocking, QRVError* error);
  // Sets `value` under `key` (a string: 38), or removes the key when `value`
  // is none; the metadata file is rewritten and the cache entry replaced
  // (45). With `useLocking` the whole read-modify-write holds the global
  // write lock, so concurrent writers never lose each other's values.
  bool setInfoValue(const QRVPlist& value, const QRVPlist& key, const QRVContainerIdentityRef& containerIdentity,
                    bool useLocking, QRVError* error);
  bool removeInfoValueForKey(const QRVPlist& key, const QRVContainerIdentityRef& containerIdentity, bool useLocking,
                             QRVError* error) {
    return setInfoValue(QRVPlist(), key, containerIdentity, useLocking, error);
  }

  // The container's user-managed assets directory: the name alone with
  // `isRelative`, otherwise the absolute path. With `createIfNecessary` the
  // (application data) container and the directory are created as needed;
  // `existed` (when not null) says whether the directory was already there.
  // A caller without the entitlement may only ask for its own identifier
  // (38). Codes: 6, 11, 21, 38, 40, 45, 71.
  std::optional<std::string> userManagedAssetsPathWithContainerIdentity(
      const QRVContainerIdentityRef& containerIdentity, bool isRelative, bool createIfNecessary, bool* existed,
      QRVError* error);
  // Removes one item of the assets directory. The path may not name the
  // directory itself, nor resolve (through "..", absolute or climbing links)
  // to anything outside it: 10. A link is removed, never what it points to.
  // Codes: 10, 11 (no path, an absolute path, or no assets directory), 21,
  // 40, 41.
  bool deleteUserManagedAssetWithContainerIdentity(const QRVContainerIdentityRef& containerIdentity,
                                                   const std::string& relativePath, QRVError* error);

  // Moves `sourceRelativePath` of the caller's own system data container to
  // `destRelativePath` of the system group container `identifier`, which the
  // caller's code signing must list (55). Neither path may leave its
  // container. Returns the destination path. Codes: 10, 11, 21, 38, 40, 55,
  // 63, 64.
  std::optional<std::string> stageSharedContentForIdentifier(const std::string& identifier,
                                                             const std::string& sourceRelativePath,
                                                             const std::string& destRelativePath, QRVError* error);

  // Bytes used by the container. A bundle container is measured once and
  // the result recorded in its info values; data containers are measured on
  // every call. Passes test lock point 2 before measuring.
  std::optional<uint64_t> diskUsageWithContainerIdentity(const QRVContainerIdentityRef& containerIdentity,
                                                         QRVError* error);

  // Renames the container directory to a fresh UUID in the same parent and
  // records the new UUID in the metadata file and the cache. Codes: 11 (the
  // directory name is not a UUID), 21, 40, 45, 48, and 34 from the file.
  QRVMetadataRef regenerateDirectoryUUIDWithContainerIdentity(const QRVContainerIdentityRef& containerIdentity,
                                                              QRVError* error);

  // Test support for clients' retry logic: makes the daemon crash
  // `numCrashes` times in a row on this request (the count survives the
  // crashes in a file under the daemon's home), then succeed and forget the
  // count. Internal builds only; the handler checks.
  bool retryTestWithNumCrashes(uint64_t numCrashes, QRVError* error);

  // Boot work, run through the shared connection at start-up.
  void rebootQuorvaSetup();
  void quorvaSetup();
  void rebootQuorvaCleanupWithCompletion(std::function<void()> completion);
  void quorvaCleanupWithCompletion(std::function<void()> completion);

  // Test hooks: the steps above that tests drive on their own.
  bool TEST_moveItemAtURLToDeathRow(const std::string& url, bool isDir, bool startDeletionThread, QRVError* error) {
    return _moveItemAtURLToDeathRow(url, isDir, startDeletionThread, error);
  }
  bool TEST_removeItemOrMoveToTempAtURL(const std::string& url, QRVError* error) {
    return _removeItemOrMoveToTempAtURL(url, error);
  }
  std::optional<QRVPlist> TEST_readAndValidateReplaceFileAtUrl(const std::string& url, QRVError* error) {
    return _readAndValidateReplaceFileAtUrl(url, error);
  }
  bool TEST_writeToDiskReplaceAt(const std::string& url, const std::string& oldURL, const std::string& newURL,
                                 const std::string& stagingURL, const std::string& destinationURL, QRVError* error) {
    return _writeToDiskReplaceAt(url, oldURL, newURL, stagingURL, destinationURL, error);
  }
  bool TEST_recoverFromReplaceOperationsWithError(QRVError* error) {
    return _recoverFromReplaceOperationsWithError(error);
  }

 private:
  // The identifiers the lookup entitlement grants for a class (memoised).
  const std::set<std::string>* _lookupForContainerClass(QRVContainerClass containerClass);
  bool _createTopLevelContainerDirectory(const std::string& url, QRVContainerClass containerClass, uid_t owner,
                                         QRVError* error);
  bool _createSubDirectories(const std::string& url, const QRVMetadata& metadata, QRVError* error);
  bool _synchronizeSubDirectories(const std::string& url, QRVContainerClass containerClass, QRVError* error);
  uint32_t _dataProtectionClassForContainerMetadata(const QRVMetadata& metadata);
  // Gives every system and system group container of this connection's user
  // a new directory UUID (after a build upgrade, so that no process keeps
  // reaching a container by a path it learned before), except the shared
  // system group.
  void _regenerateAllSystemContainerPaths();
  // Restores the system and system group containers of a backup into their
  // live containers, child by child. What cannot be restored ends in the
  // backup's ".failed" tree; nothing is deleted.
  void _restoreSystemContainersFromBackup();
  void _moveSystemContainerIntoPlace(const std::string& entry, QRVContainerClass containerClass);
  void _moveFailedPathAside(const std::string& item, const std::string& failedItems, const std::string& name);
  // Sends to death row every entry of `directories` that can be a container
  // of `containerClass` by its name but has no metadata file: what a crash
  // or an older system left. Other entries are left alone.
  void _cleanupOrphanedDataForDirectories(const std::vector<std::string>& directories,
                                          QRVContainerClass containerClass);
  // Drops the code-signing records kept ahead of an installation that never
  // came.
  void _cleanupOprhanedCodeSigningMappingData();
  // Moves `url` into a fresh directory on death row under its own name. A
  // missing item is success. Fails with 41. With `startDeletionThread` the
  // emptying of death row is started.
  bool _moveItemAtURLToDeathRow(const std::string& url, bool isDir, bool startDeletionThread, QRVError* error);
  // Removes `url` recursively; what cannot be removed is moved to "/tmp"
  // (under the root) instead, failing with 4 when even that fails.
  bool _removeItemOrMoveToTempAtURL(const std::string& url, QRVError* error);
  // The journal's four directories (old, new, staging, destination) as a
  // dictionary of absolute paths; 35 when unreadable or incomplete.
  std::optional<QRVPlist> _readAndValidateReplaceFileAtUrl(const std::string& url, QRVError* error);
  // 33 when a path is empty, 34 when the write fails.
  bool _writeToDiskReplaceAt(const std::string& url, const std::string& oldURL, const std::string& newURL,
                             const std::string& stagingURL, const std::string& destinationURL, QRVError* error);
  // Finishes or rolls back every replace left in the replace directory.
  bool _recoverFromReplaceOperationsWithError(QRVError* error);
  // Adds the last path component of the staging directory each journal left
  // in the replace directory names: parked old containers that the start-up
  // cleanup must leave alone. False when a journal there cannot be read (or
  // the directory cannot be listed), so that nothing it may name is known.
  bool _stagingItemsNamedByReplaceFiles(std::set<std::string>* names);
  // The journals in the replace directory (none when it does not exist);
  // a listing that fails is logged and returned.
  std::optional<std::vector<std::string>> _replaceFileURLs(QRVError* error);
  // Look-up without creation for the operations above; 21 carries the
  // identity. Without `useLocking` the caller holds the global lock.
  QRVMetadataRef _existingContainer(const QRVContainerIdentityRef& containerIdentity, bool useLocking,
                                    QRVError* error);
  // Writes `metadata`'s file and replaces its cache entry (45).
  bool _storeMetadata(const QRVMetadataRef& metadata, QRVError* error);

  const std::shared_ptr<const QRVClientIdentity> clientIdentity_;
  const bool entitled_;
  bool allowOtherIdLookup_;
  bool allowGroupIdLookup_ = false;
  bool unrestricted_;
  const std::optional<QRVPlist> lookup_;
  const std::optional<QRVPlist::Array> entitledWipeIdentifiers_;
  const std::shared_ptr<QRVCommandQueue> commandQueue_;
  const std::shared_ptr<QRVServices> services_;

  QRVMutex lookupMemoMutex_;
  std::map<std::string, std::set<std::string>> lookupMemo_ GUARDED_BY(lookupMemoMutex_);
};

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
#include <mutex>
#include <set>
#include <vector>
#include <memory>
#include <optional>

#include "QRVClientIdentity.h"
#include "QRVCommandQueue.h"
#include "QRVContainerIdentity.h"
#include "QRVMetadata.h"
#include "QRVPlist.h"
#include "QRVServices.h"

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

  // Whether the caller's lookup entitlement lists `identifier` for the class.
  bool isEntitledForLookupWithClass(QRVContainerClass containerClass, const std::string& identifier);
  // The identifiers the lookup entitlement grants for a class (memoised).
  const std::set<std::string>* _lookupForContainerClass(QRVContainerClass containerClass);
  bool _createTopLevelContainerDirectory(const std::string& url, QRVContainerClass containerClass, uid_t owner,
                                         QRVError* error);
  bool _createSubDirectories(const std::string& url, const QRVMetadata& metadata, QRVError* error);
  uint32_t _dataProtectionClassForContainerMetadata(const QRVMetadata& metadata);

  // ---- Death row ----
  // Removed containers are first renamed into a unique directory under the
  // death-row directory (atomic on one volume), then deleted in the
  // background. Both steps survive a crash: whatever is on death row stays
  // there until the next emptying.

  // Moves `url` into a fresh directory on death row under its own name. A
  // missing item is success. Fails with 41. With `startDeletionThread` the
  // emptying of death row is started.
  bool _moveItemAtURLToDeathRow(const std::string& url, bool isDir, bool startDeletionThread, QRVError* error);
  // Empties death row on the death-row queue, inside a keep-alive
  // transaction, then calls `completion` (may be empty) there.
  void deleteContainersOnDeathRowWithCompletion(std::function<void()> completion);
  // Removes `url` recursively; what cannot be removed is moved to "/tmp"
  // (under the root) instead, failing with 4 when even that fails.
  bool _removeItemOrMoveToTempAtURL(const std::string& url, QRVError* error);

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

 private:
  const std::shared_ptr<const QRVClientIdentity> clientIdentity_;
  const bool entitled_;
  bool allowOtherIdLookup_;
  bool allowGroupIdLookup_ = false;
  bool unrestricted_;
  const std::optional<QRVPlist> lookup_;
  const std::optional<QRVPlist::Array> entitledWipeIdentifiers_;
  const std::shared_ptr<QRVCommandQueue> commandQueue_;
  const std::shared_ptr<QRVServices> services_;

  std::mutex lookupMemoMutex_;
  std::map<std::string, std::set<std::string>> lookupMemo_;  // GUARDED_BY(lookupMemoMutex_)
};

// The per-request view of a client: who it is, what it may do, and the
// request's command queue. The container operations are methods of this
// class, so each one sees the caller's powers.
//
// A connection lives for one request, except the daemon's own shared
// connection (privileged, unrestricted), which serves boot set-up and
// cleanup for the life of the process.
#pragma once

#include <functional>
#include <memory>
#include <optional>

#include "QRVClientIdentity.h"
#include "QRVCommandQueue.h"
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
};

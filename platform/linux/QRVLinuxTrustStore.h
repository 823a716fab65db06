// Trust store backed by <root>/etc/quorva/clients.d/: one property list per
// client with "SigningIdentifier" (string), "Entitlements" (dictionary) and
// what a peer must match, "Executable" (absolute path, compared by device and
// inode with /proc/<pid>/exe) and/or "UID". An entry with neither matches
// nobody. Entries are tried in file-name order; the first match wins.
//
// The directory is watched with inotify and re-read on the next look-up after
// a change, so look-ups cost no file I/O in the steady state.
#pragma once

#include <atomic>
#include <string>
#include <vector>

#include "base/QRVMutex.h"
#include "platform/QRVTrustStore.h"
#include "platform/linux/QRVProcInfo.h"

class QRVLinuxTrustStore : public QRVTrustStore {
 public:
  explicit QRVLinuxTrustStore(std::string directory);
  ~QRVLinuxTrustStore() override;

  std::optional<std::string> signingIdentifierForAuditToken(const QRVAuditToken& token,
                                                            QRVError* error) override;
  std::optional<QRVPlist> entitlementsForAuditToken(const QRVAuditToken& token) override;
  std::optional<std::string> executablePathForUnlistedAuditToken(const QRVAuditToken& token) override;
  // Reads the directory's pending change events without taking the lock.
  std::optional<uint64_t> changeCount() override;

 private:
  struct Entry {
    std::string file;
    std::string signingIdentifier;
    QRVPlist entitlements;
    std::optional<QRVProcInfo::FileId> executable;
    bool executableMissing = false;  // named a path that does not exist: matches nobody
    std::optional<uid_t> uid;
  };

  // The entry for the live process behind `token`, or null.
  const Entry* match(const QRVAuditToken& token) REQUIRES(mutex_);
  void reloadIfChangedLocked() REQUIRES(mutex_);
  // Consumes pending change events; true when there were any.
  bool drainEvents();
  void loadLocked() REQUIRES(mutex_);

  const std::string directory_;
  QRVMutex mutex_;
  int inotifyFd_ = -1;
  // Set (before changes_ counts up) when changeCount() consumed events that
  // the next look-up must act on.
  std::atomic<bool> reloadNeeded_{false};
  std::atomic<uint64_t> changes_{0};
  bool loaded_ GUARDED_BY(mutex_) = false;
  std::vector<Entry> entries_ GUARDED_BY(mutex_);
};

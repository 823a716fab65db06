// Test locks: lets a test harness (through the testability command) hold the
// all-identifiers lock, or stop container operations at chosen points, for as
// long as it likes, to provoke races on purpose.
//
// Six locks. 0 holds the all-identifiers read lock, 1 the all-identifiers
// write lock. 2 to 5 are blocking points: daemon code calls `waitOnLock(n)` at
// such a point, and while lock n is held that call does not return (lock 2 is
// passed by the disk-usage operation). Each lock counts its acquisitions; the
// real lock is taken when the count leaves 0 and given back when it returns
// to 0. When the feature is disabled `waitOnLock` returns at once.
//
// Thread-safe. All counts change on one serial state queue. Acquiring lock 0
// or 1 waits, on that queue, until the all-identifiers lock is granted.
#pragma once

#include <array>
#include <atomic>
#include <bitset>
#include <cstdint>
#include <memory>
#include <semaphore>

#include "base/QRVError.h"
#include "base/QRVMutex.h"
#include "base/QRVSerialQueue.h"

class QRVTestLocks {
 public:
  static constexpr uint64_t kGlobalReadLock = 0;
  static constexpr uint64_t kGlobalWriteLock = 1;
  static constexpr uint64_t kFirstBlockingPoint = 2;
  static constexpr uint64_t kLockCount = 6;

  QRVTestLocks();
  // Gives back whatever is still held, so that a discarded instance never
  // leaves the process-wide lock taken.
  ~QRVTestLocks();
  QRVTestLocks(const QRVTestLocks&) = delete;
  QRVTestLocks& operator=(const QRVTestLocks&) = delete;

  void setEnabled(bool enabled);
  bool enabled() const { return enabled_.load(); }

  // `lock` must be below kLockCount; other numbers are refused (logged,
  // false). So is lock 0 while lock 1 is held, or 1 while 0 is: both are
  // the all-identifiers lock, which the state queue would wait on forever.
  // Releasing more often than acquiring ends the process.
  bool acquireLock(uint64_t lock);
  bool releaseLock(uint64_t lock);
  void releaseAllLocks();
  // The blocking point `lock` (2 to 5): returns once the lock is not held,
  // or at once when the feature is disabled. Other numbers have no blocking
  // point and return at once.
  void waitOnLock(uint64_t lock);

  // The testability command. Remembers which locks the command holds:
  // enabling a lock not yet held marks it, enables the feature and acquires
  // it; disabling a held one unmarks it (0 and 1 together, as they are one
  // lock underneath), releases it, and disables the feature when nothing is
  // marked any more. Lock 6 with `enable` false disables the feature and
  // releases everything. Any other number of 6 or more is error 38, and so
  // is enabling 0 while 1 is held or 1 while 0 is.
  bool setLockFromCommand(uint64_t lock, bool enable, QRVError* error);

  int64_t TEST_lockCount(uint64_t lock);

 private:
  // What a waiter and the barrier job share; outlives this object while a
  // barrier still sits on the queue.
  struct BlockingPoint {
    std::shared_ptr<QRVSerialQueue> lockQueue;
    std::counting_semaphore<> lockSemaphore{0};
  };

  // REQUIRES: running on stateQueue_.
  void _stateQueue_changeCount(uint64_t lock, int64_t delta);
  void _stateQueue_acquire(uint64_t lock);
  void _stateQueue_release(uint64_t lock);
  // The other of locks 0 and 1 when it is held and `lock` is its partner;
  // kLockCount otherwise.
  uint64_t _stateQueue_conflictingLock(uint64_t lock) const;

  const std::shared_ptr<QRVSerialQueue> stateQueue_;
  std::array<std::shared_ptr<BlockingPoint>, kLockCount> points_;  // null for 0 and 1
  std::array<int64_t, kLockCount> lockCount_{};                    // changed on stateQueue_ only
  std::atomic<bool> enabled_{false};

  QRVMutex commandMutex_;
  std::bitset<kLockCount> heldByCommand_ GUARDED_BY(commandMutex_);
};

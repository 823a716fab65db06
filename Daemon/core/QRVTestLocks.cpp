#include "core/QRVTestLocks.h"

#include "base/QRVLog.h"
#include "base/QRVUUID.h"
#include "core/QRVExceptionReporter.h"
#include "core/QRVLocks.h"

QRVTestLocks::QRVTestLocks() : stateQueue_(QRVSerialQueue::create("com.kelva.quorvad.QRVTestLocks.stateQueue")) {
  for (uint64_t lock = kFirstBlockingPoint; lock < kLockCount; lock++) {
    points_[lock] = std::make_shared<BlockingPoint>();
    points_[lock]->lockQueue = QRVSerialQueue::create("com.kelva.quorvad.QRVTestLocks.lockQueue");
  }
}

QRVTestLocks::~QRVTestLocks() {
  stateQueue_->sync([this] {
    for (uint64_t lock = 0; lock < kLockCount; lock++)
      if (lockCount_[lock] > 0) _stateQueue_changeCount(lock, -lockCount_[lock]);
  });
}

void QRVTestLocks::_stateQueue_acquire(uint64_t lock) {
  if (lock == kGlobalReadLock) {
    lock_all_identifiers_for_reading();
  } else if (lock == kGlobalWriteLock) {
    lock_all_identifiers_for_writing();
  } else {
    // The barrier sits on the point's queue until released; every waiter
    // queues up behind it. It owns a reference to the point so that it can
    // finish even after this object is gone.
    std::shared_ptr<BlockingPoint> point = points_[lock];
    point->lockQueue->barrierAsync([point, lock] {
      QRVLogNotice("Blocking waiters for lock: {}", lock);
      point->lockSemaphore.acquire();
      QRVLogNotice("Unblocking waiters for lock: {}", lock);
    });
  }
}

void QRVTestLocks::_stateQueue_release(uint64_t lock) {
  if (lock == kGlobalReadLock || lock == kGlobalWriteLock) {
    unlock_all_identifiers();
  } else {
    points_[lock]->lockSemaphore.release();
  }
}

void QRVTestLocks::_stateQueue_changeCount(uint64_t lock, int64_t delta) {
  const int64_t from = lockCount_[lock];
  const int64_t to = from + delta;
  if (to < 0) QRVTerminate(fmt::format("Unbalanced update to test lock: {} by: {} from: {}", lock, delta, from));
  if (from == 0 && to > 0) {
    _stateQueue_acquire(lock);
  } else if (from > 0 && to == 0) {
    _stateQueue_release(lock);
  }
  lockCount_[lock] = to;
}

uint64_t QRVTestLocks::_stateQueue_conflictingLock(uint64_t lock) const {
  if (lock == kGlobalReadLock && lockCount_[kGlobalWriteLock] > 0) return kGlobalWriteLock;
  if (lock == kGlobalWriteLock && lockCount_[kGlobalReadLock] > 0) return kGlobalReadLock;
  return kLockCount;
}

bool QRVTestLocks::acquireLock(uint64_t lock) {
  if (lock >= kLockCount) {
    QRVLogError("No test lock {}", lock);
    return false;
  }
  uint64_t conflict = kLockCount;
  stateQueue_->sync([&] {
    // Locks 0 and 1 are the same all-identifiers lock taken two ways, and
    // we would be waiting for ourselves: the state queue would block for
    // good, and every later request with it.
    conflict = _stateQueue_conflictingLock(lock);
    if (conflict != kLockCount) return;
    _stateQueue_changeCount(lock, +1);
    QRVLogNotice("Acquired test lock: {}; count: {}", lock, lockCount_[lock]);
  });
  if (conflict != kLockCount) {
    QRVLogError("Refusing test lock {}: test lock {} already holds the all-identifiers lock", lock, conflict);
    return false;
  }
  return true;
}

bool QRVTestLocks::releaseLock(uint64_t lock) {
  if (lock >= kLockCount) {
    QRVLogError("No test lock {}", lock);
    return false;
  }
  stateQueue_->sync([&] {
    _stateQueue_changeCount(lock, -1);
    QRVLogNotice("Released test lock: {}; count: {}", lock, lockCount_[lock]);
  });
  return true;
}

void QRVTestLocks::releaseAllLocks() {
  stateQueue_->sync([&] {
    for (uint64_t lock = 0; lock < kLockCount; lock++)
      if (lockCount_[lock] != 0) _stateQueue_changeCount(lock, -lockCount_[lock]);
    QRVLogNotice("Released all test locks.");
  });
}

void QRVTestLocks::setEnabled(bool enabled) {
  if (enabled) {
    if (!enabled_.exchange(true)) QRVLogNotice("Enabled test locks feature.");
    return;
  }
  if (!enabled_.load()) return;
  // Nothing may stay blocked once the feature is off.
  releaseAllLocks();
  if (enabled_.exchange(false)) QRVLogNotice("Disabled test locks feature.");
}

void QRVTestLocks::waitOnLock(uint64_t lock) {
  if (!enabled_.load()) return;
  if (lock < kFirstBlockingPoint || lock >= kLockCount) {
    QRVLogError("No blocking point for test lock {}", lock);
    return;
  }
  const std::string tag = QRVUUID::random().string();
  QRVLogNotice("[{}] Waiting on lock: {}", tag, lock);
  // Cannot start while an acquired lock's barrier sits on the queue.
  points_[lock]->lockQueue->sync([&] { QRVLogNotice("[{}] No longer waiting on lock: {}", tag, lock); });
}

bool QRVTestLocks::setLockFromCommand(uint64_t lock, bool enable, QRVError* error) {
  if (lock >= kLockCount) {
    if (lock == kLockCount && !enable) {
      {
        QRVMutexLock guard(&commandMutex_);
        heldByCommand_.reset();
      }
      setEnabled(false);
      return true;
    }
    return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput, "Invalid test lock: {}, enable: {}", lock, enable));
  }
  if (enable) {
    {
      QRVMutexLock guard(&commandMutex_);
      if (heldByCommand_.test(lock)) return true;
      heldByCommand_.set(lock);
    }
    setEnabled(true);
    if (!acquireLock(lock)) {
      QRVMutexLock guard(&commandMutex_);
      heldByCommand_.reset(lock);
      return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput,
                                      "Test lock {} conflicts with the all-identifiers lock already held", lock));
    }
    return true;
  }
  bool noneLeft;
  {
    QRVMutexLock guard(&commandMutex_);
    if (!heldByCommand_.test(lock)) return true;
    if (lock == kGlobalReadLock || lock == kGlobalWriteLock) {
      // One all-identifiers lock underneath: releasing either gives it up.
      heldByCommand_.reset(kGlobalReadLock);
      heldByCommand_.reset(kGlobalWriteLock);
    } else {
      heldByCommand_.reset(lock);
    }
    noneLeft = heldByCommand_.none();
  }
  releaseLock(lock);
  if (noneLeft) setEnabled(false);
  return true;
}

int64_t QRVTestLocks::TEST_lockCount(uint64_t lock) {
  int64_t count = 0;
  if (lock < kLockCount) stateQueue_->sync([&] { count = lockCount_[lock]; });
  return count;
}

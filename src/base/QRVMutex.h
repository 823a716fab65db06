// A mutex the thread-safety analysis knows about, and its scoped lock.
//
// libstdc++'s std::mutex carries no capability attributes, so data marked
// GUARDED_BY a std::mutex would go unchecked. QRVMutex is a std::mutex with
// the attributes; QRVMutexLock holds one for a scope. Wait on a QRVMutex with
// QRVCondVar.
#pragma once

#include <mutex>

#include "base/QRVThreadAnnotations.h"

class QRVCondVar;

class CAPABILITY("mutex") QRVMutex {
 public:
  QRVMutex() = default;
  QRVMutex(const QRVMutex&) = delete;
  QRVMutex& operator=(const QRVMutex&) = delete;

  void lock() ACQUIRE() { mutex_.lock(); }
  void unlock() RELEASE() { mutex_.unlock(); }
  // Tells the analysis the lock is held where it cannot see that itself
  // (a callback documented to run under the lock). std::mutex cannot tell
  // who holds it, so nothing is checked at run time.
  void assertHeld() const ASSERT_CAPABILITY(this) {}

 private:
  friend class QRVCondVar;
  std::mutex mutex_;
};

// Holds `mutex` from construction to destruction. `unlock()` and `lock()`
// let go for a stretch inside the scope (to run a job without the lock);
// the destructor releases only what is still held.
class SCOPED_CAPABILITY QRVMutexLock {
 public:
  explicit QRVMutexLock(QRVMutex* mutex) ACQUIRE(mutex) : mutex_(mutex) { mutex_->lock(); }
  ~QRVMutexLock() RELEASE() {
    if (held_) mutex_->unlock();
  }
  QRVMutexLock(const QRVMutexLock&) = delete;
  QRVMutexLock& operator=(const QRVMutexLock&) = delete;

  void unlock() RELEASE() {
    mutex_->unlock();
    held_ = false;
  }
  void lock() ACQUIRE() {
    mutex_->lock();
    held_ = true;
  }

 private:
  QRVMutex* const mutex_;
  bool held_ = true;
};

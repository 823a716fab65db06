// A recursive mutex the thread-safety analysis knows about, and its scoped
// lock.
//
// The configuration monitors are taken again by code that already holds
// them (a getter called from a setter). The analysis itself does not model
// re-entry: it would reject taking the lock twice in one function, but
// between functions it only sees what REQUIRES and EXCLUDES say, so leave
// EXCLUDES off the methods that may be re-entered.
#pragma once

#include <mutex>

#include "base/QRVThreadAnnotations.h"

class CAPABILITY("mutex") QRVRecursiveMutex {
 public:
  QRVRecursiveMutex() = default;
  QRVRecursiveMutex(const QRVRecursiveMutex&) = delete;
  QRVRecursiveMutex& operator=(const QRVRecursiveMutex&) = delete;

  void lock() ACQUIRE() { mutex_.lock(); }
  void unlock() RELEASE() { mutex_.unlock(); }

 private:
  std::recursive_mutex mutex_;
};

class SCOPED_CAPABILITY QRVRecursiveMutexLock {
 public:
  explicit QRVRecursiveMutexLock(QRVRecursiveMutex* mutex) ACQUIRE(mutex) : mutex_(mutex) { mutex_->lock(); }
  ~QRVRecursiveMutexLock() RELEASE() { mutex_->unlock(); }
  QRVRecursiveMutexLock(const QRVRecursiveMutexLock&) = delete;
  QRVRecursiveMutexLock& operator=(const QRVRecursiveMutexLock&) = delete;

 private:
  QRVRecursiveMutex* const mutex_;
};

// A condition variable for QRVMutex.
//
// Every wait names the mutex, which the caller must hold; it is released
// while asleep and held again on return, as with std::condition_variable.
// There are no predicate forms: a predicate is a lambda, and the analysis
// cannot see that a lambda runs under the lock, so callers write the loop:
//
//   QRVMutexLock lock(&mutex_);
//   while (queue_.empty()) nonEmpty_.wait(&mutex_);
#pragma once

#include <chrono>
#include <condition_variable>

#include "base/QRVMutex.h"

class QRVCondVar {
 public:
  QRVCondVar() = default;
  QRVCondVar(const QRVCondVar&) = delete;
  QRVCondVar& operator=(const QRVCondVar&) = delete;

  // May wake without a signal; check the condition again.
  void wait(QRVMutex* mutex) REQUIRES(mutex);
  // False when `deadline` passed first.
  bool waitUntil(QRVMutex* mutex, std::chrono::steady_clock::time_point deadline) REQUIRES(mutex);

  void signal() { cv_.notify_one(); }
  void signalAll() { cv_.notify_all(); }

 private:
  std::condition_variable cv_;
};

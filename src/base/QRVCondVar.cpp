#include "base/QRVCondVar.h"

// The std::unique_lock adopts the caller's lock for the wait and gives it
// back afterwards without unlocking, so the mutex is held on return exactly
// as it was on entry.

void QRVCondVar::wait(QRVMutex* mutex) {
  std::unique_lock<std::mutex> lock(mutex->mutex_, std::adopt_lock);
  cv_.wait(lock);
  lock.release();
}

bool QRVCondVar::waitUntil(QRVMutex* mutex, std::chrono::steady_clock::time_point deadline) {
  std::unique_lock<std::mutex> lock(mutex->mutex_, std::adopt_lock);
  const bool signalled = cv_.wait_until(lock, deadline) == std::cv_status::no_timeout;
  lock.release();
  return signalled;
}

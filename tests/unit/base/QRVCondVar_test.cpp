#include "base/QRVCondVar.h"

#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <thread>

namespace {

using namespace std::chrono_literals;

TEST(QRVCondVar, WaiterSeesTheChangeMadeUnderTheMutex) {
  QRVMutex mutex;
  QRVCondVar changed;
  bool ready = false;
  std::thread producer([&] {
    std::this_thread::sleep_for(20ms);
    QRVMutexLock lock(&mutex);
    ready = true;
    changed.signalAll();
  });
  {
    QRVMutexLock lock(&mutex);
    while (!ready) changed.wait(&mutex);
    EXPECT_TRUE(ready);
  }
  producer.join();
}

TEST(QRVCondVar, WaitUntilReportsTheTimeoutAndStillHoldsTheMutex) {
  QRVMutex mutex;
  QRVCondVar never;
  QRVMutexLock lock(&mutex);
  const auto start = std::chrono::steady_clock::now();
  bool signalled = true;
  // A spurious wake-up returns true; only the deadline ends the loop.
  while (signalled) signalled = never.waitUntil(&mutex, start + 30ms);
  EXPECT_FALSE(signalled);
  EXPECT_GE(std::chrono::steady_clock::now() - start, 30ms);

  // Held again on return: another thread cannot get in until we let go.
  std::promise<void> taken;
  std::thread other([&] {
    QRVMutexLock otherLock(&mutex);
    taken.set_value();
  });
  std::future<void> done = taken.get_future();
  EXPECT_EQ(done.wait_for(50ms), std::future_status::timeout);
  lock.unlock();
  EXPECT_EQ(done.wait_for(10s), std::future_status::ready);
  other.join();
}

TEST(QRVCondVar, WaitUntilReturnsTrueWhenSignalledBeforeTheDeadline) {
  QRVMutex mutex;
  QRVCondVar changed;
  bool ready = false;
  std::thread producer([&] {
    QRVMutexLock lock(&mutex);
    ready = true;
    changed.signal();
  });
  bool inTime = true;
  {
    QRVMutexLock lock(&mutex);
    const auto deadline = std::chrono::steady_clock::now() + 10s;
    while (!ready && inTime) inTime = changed.waitUntil(&mutex, deadline);
  }
  producer.join();
  EXPECT_TRUE(inTime);
  EXPECT_TRUE(ready);
}

}  // namespace

#include "base/QRVMutex.h"

#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <optional>
#include <thread>

namespace {

using namespace std::chrono_literals;

// Another thread that takes `mutex` and lets go again at once; `entered`
// becomes ready when it got in.
struct Contender {
  explicit Contender(QRVMutex& mutex)
      : thread([&mutex, this] {
          QRVMutexLock lock(&mutex);
          got.set_value();
        }) {}
  ~Contender() { thread.join(); }
  bool enteredWithin(std::chrono::milliseconds timeout) {
    return entered.wait_for(timeout) == std::future_status::ready;
  }

  std::promise<void> got;
  std::future<void> entered = got.get_future();
  std::thread thread;
};

TEST(QRVMutexLock, HoldsTheMutexForItsScopeOnly) {
  QRVMutex mutex;
  std::optional<Contender> contender;
  {
    QRVMutexLock lock(&mutex);
    contender.emplace(mutex);
    EXPECT_FALSE(contender->enteredWithin(50ms));
  }
  EXPECT_TRUE(contender->enteredWithin(10s));
}

TEST(QRVMutexLock, UnlockLetsOthersInAndTheDestructorReleasesOnlyWhatIsHeld) {
  QRVMutex mutex;
  int shared = 0;
  {
    QRVMutexLock lock(&mutex);
    lock.unlock();
    std::thread([&] {
      QRVMutexLock other(&mutex);
      shared = 1;
    }).join();
    lock.lock();
    EXPECT_EQ(shared, 1);
    lock.unlock();
  }
  // Released once, not twice: the mutex still works as a mutex.
  Contender contender(mutex);
  EXPECT_TRUE(contender.enteredWithin(10s));
}

}  // namespace

#include "core/QRVTestLocks.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <thread>

#include "core/QRVLocks.h"
#include "core/QRVRelayDispatcher.h"
#include "operations/QRVClientConnection.h"
#include "support/QRVEventually.h"
#include "support/QRVTestConnection.h"
#include "support/QRVTestServices.h"

namespace {

using namespace std::chrono_literals;

// Runs `work` on its own thread and tells when it has returned.
class Background {
 public:
  explicit Background(std::function<void()> work) : thread_([this, work] {
    work();
    done_ = true;
  }) {}
  ~Background() { thread_.join(); }
  bool waitDone() { return QRVEventually([this] { return done_.load(); }); }
  bool stillRunning() {
    std::this_thread::sleep_for(30ms);
    return !done_;
  }

 private:
  std::atomic<bool> done_{false};
  std::thread thread_;
};

int32_t globalState() { return TEST_lock_table_snapshot().allReaderWriterState; }

TEST(QRVTestLocksTest, BlockingPointHoldsWaitersUntilTheLastReleaseWhileEnabled) {
  QRVTestLocks locks;
  locks.acquireLock(2);
  locks.waitOnLock(2);  // disabled: passes even though the lock is held
  locks.setEnabled(true);
  locks.acquireLock(2);
  EXPECT_EQ(locks.TEST_lockCount(2), 2);
  {
    Background waiter([&] { locks.waitOnLock(2); });
    locks.waitOnLock(3);  // other points are free
    EXPECT_TRUE(waiter.stillRunning());
    locks.releaseLock(2);
    EXPECT_TRUE(waiter.stillRunning());
    locks.releaseLock(2);
    EXPECT_TRUE(waiter.waitDone());
  }
  // Taken again after a release, it blocks again.
  locks.acquireLock(2);
  {
    Background waiter([&] { locks.waitOnLock(2); });
    EXPECT_TRUE(waiter.stillRunning());
    locks.releaseLock(2);
    EXPECT_TRUE(waiter.waitDone());
  }
  EXPECT_FALSE(locks.acquireLock(6));
  EXPECT_FALSE(locks.releaseLock(6));
}

TEST(QRVTestLocksTest, LocksZeroAndOneHoldTheAllIdentifiersLock) {
  QRVTestLocks locks;
  locks.acquireLock(QRVTestLocks::kGlobalReadLock);
  EXPECT_EQ(globalState(), 1);
  {
    Background writer([] { lock_identifier_for_writing("X"); });
    EXPECT_TRUE(writer.stillRunning());
    locks.releaseLock(QRVTestLocks::kGlobalReadLock);
    EXPECT_TRUE(writer.waitDone());
  }
  EXPECT_EQ(globalState(), 0);
  {
    // The global write lock waits for X's writer: acquiring blocks the caller.
    Background acquire([&] { locks.acquireLock(QRVTestLocks::kGlobalWriteLock); });
    EXPECT_TRUE(acquire.stillRunning());
    unlock_identifier("X");
    EXPECT_TRUE(acquire.waitDone());
  }
  EXPECT_EQ(globalState(), -1);
  locks.releaseLock(QRVTestLocks::kGlobalWriteLock);
  EXPECT_EQ(globalState(), 0);
}

// Taking the all-identifiers lock the other way while the test locks hold it
// would wait for ourselves on the state queue. The call runs on a thread of
// its own so that a regression fails the test instead of hanging it (the
// thread then keeps the wedged object, whose destructor would wait too).
TEST(QRVTestLocksTest, TheOtherGlobalLockIsRefusedWhileOneIsHeld) {
  auto shared = std::make_shared<QRVTestLocks>();
  QRVTestLocks& locks = *shared;
  for (auto [held, other] : {std::pair{QRVTestLocks::kGlobalWriteLock, QRVTestLocks::kGlobalReadLock},
                             std::pair{QRVTestLocks::kGlobalReadLock, QRVTestLocks::kGlobalWriteLock}}) {
    SCOPED_TRACE(testing::Message() << "held " << held << ", then " << other);
    ASSERT_TRUE(locks.acquireLock(held));
    auto result = std::make_shared<std::atomic<int>>(-1);
    std::thread([shared, result, other = other] { *result = shared->acquireLock(other) ? 1 : 0; }).detach();
    ASSERT_TRUE(QRVEventually([&] { return *result != -1; })) << "acquiring the other global lock blocked";
    EXPECT_EQ(*result, 0);
    // The state queue still answers, and nothing was counted.
    EXPECT_EQ(locks.TEST_lockCount(other), 0);
    EXPECT_EQ(locks.TEST_lockCount(held), 1);
    EXPECT_TRUE(locks.releaseLock(held));
    EXPECT_EQ(globalState(), 0);
  }
}

TEST(QRVTestLocksTest, DisablingOrDestroyingReleasesEverything) {
  {
    QRVTestLocks locks;
    locks.setEnabled(true);
    locks.acquireLock(0);
    locks.acquireLock(4);
    locks.acquireLock(4);
    Background waiter([&] { locks.waitOnLock(4); });
    EXPECT_TRUE(waiter.stillRunning());
    locks.setEnabled(false);
    EXPECT_TRUE(waiter.waitDone());
    EXPECT_EQ(locks.TEST_lockCount(4), 0);
    EXPECT_EQ(globalState(), 0);
    locks.acquireLock(1);
    EXPECT_EQ(globalState(), -1);
  }
  EXPECT_EQ(globalState(), 0);
}

TEST(QRVTestLocksTest, UnbalancedReleaseEndsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  QRVTestLocks locks;
  EXPECT_DEATH(locks.releaseLock(3), "Unbalanced update to test lock: 3 by: -1 from: 0");
}

// --- The testability command ------------------------------------------------------

class SetTestLockCommandTest : public testing::Test {
 protected:
  void SetUp() override {
    env_.trustStore->setClient(
        50, {"com.example.tests", QRVPlist::dictionary().set(kEntitlementTestability, QRVPlist::boolean(true))});
    env_.systemInfo->internal = true;  // the build variant as the daemon first reads it
  }
  void TearDown() override { locks().setEnabled(false); }

  QRVTestLocks& locks() { return *env_.services->testLocks; }

  uint64_t send(uint64_t lock, bool enable) {
    QRVRelayDispatcher dispatcher(env_.services);
    auto connection = std::make_shared<QRVTestConnection>(50);
    QRVPlist body = QRVPlist::dictionary()
                        .set("Command", QRVPlist::uinteger(31))
                        .set("TestLock", QRVPlist::uinteger(lock))
                        .set("Enable", QRVPlist::boolean(enable));
    dispatcher.QRVProcessRelayEvent(connection, connection->message(std::move(body), 3));
    return connection->replies.size() == 1 ? connection->replies[0].second.uint64ForKey("ReplyError") : 0;
  }

  QRVTestServices env_;
};

TEST_F(SetTestLockCommandTest, EachLockIsHeldOnceAndTheLastDisableOrLockSixTurnsTheFeatureOff) {
  EXPECT_EQ(send(2, true), 1u);
  EXPECT_EQ(send(2, true), 1u);  // already held: not counted twice
  EXPECT_TRUE(locks().enabled());
  EXPECT_EQ(locks().TEST_lockCount(2), 1);
  EXPECT_EQ(send(0, true), 1u);
  EXPECT_EQ(globalState(), 1);
  EXPECT_EQ(send(2, false), 1u);
  EXPECT_EQ(locks().TEST_lockCount(2), 0);
  EXPECT_TRUE(locks().enabled());  // lock 0 is still marked
  EXPECT_EQ(send(1, false), 1u);   // 1 was never marked: nothing happens
  EXPECT_EQ(globalState(), 1);
  EXPECT_EQ(send(0, false), 1u);
  EXPECT_EQ(globalState(), 0);
  EXPECT_FALSE(locks().enabled());

  // Lock 6 turned off disables everything; other numbers from 6 on are invalid.
  EXPECT_EQ(send(3, true), 1u);
  EXPECT_EQ(send(1, true), 1u);
  EXPECT_EQ(globalState(), -1);
  EXPECT_EQ(send(6, true), 38u);
  EXPECT_EQ(send(7, false), 38u);
  EXPECT_EQ(send(6, false), 1u);
  EXPECT_FALSE(locks().enabled());
  EXPECT_EQ(globalState(), 0);
  EXPECT_EQ(locks().TEST_lockCount(3), 0);
  // The marks went with it: enabling again takes the lock again.
  EXPECT_EQ(send(3, true), 1u);
  EXPECT_EQ(locks().TEST_lockCount(3), 1);

  EXPECT_EQ(send(6, false), 1u);

  // Enabling one global lock while the other is held is refused, and the
  // command keeps answering afterwards.
  EXPECT_EQ(send(1, true), 1u);
  EXPECT_EQ(send(0, true), 38u);
  EXPECT_EQ(globalState(), -1);
  EXPECT_EQ(send(2, true), 1u);
  EXPECT_EQ(send(1, false), 1u);
  EXPECT_EQ(globalState(), 0);
  EXPECT_EQ(send(0, true), 1u);  // the refusal left no mark behind
  EXPECT_EQ(send(1, true), 38u);
  EXPECT_EQ(globalState(), 1);
  EXPECT_EQ(send(6, false), 1u);
  EXPECT_EQ(globalState(), 0);
  EXPECT_EQ(send(3, true), 1u);

  // Not an internal build: the command answers success and changes nothing.
  env_.services->globalConfiguration->setIsInternalImage(false);
  EXPECT_EQ(send(1, true), 1u);
  EXPECT_EQ(send(3, false), 1u);
  EXPECT_EQ(globalState(), 0);
  EXPECT_EQ(locks().TEST_lockCount(3), 1);
}

}  // namespace

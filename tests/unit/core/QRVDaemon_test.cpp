#include "core/QRVDaemon.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <thread>

#include "base/QRVLog.h"
#include "dataprotection/QRVDataProtectionManager.h"
#include "operations/QRVClientConnection.h"
#include "support/QRVFiles.h"
#include "support/QRVEventually.h"
#include "support/QRVTestConnection.h"
#include "support/QRVTestServices.h"

namespace {

class DaemonTest : public testing::Test {
 protected:
  void TearDown() override { QRVLog::close(); }

  // Runs start-up and waits for its cleanups, which run on their own queue and
  // whose completions refer to the daemon, to post their notifications.
  std::unique_ptr<QRVDaemon> startDaemon() {
    size_t before = env_.notifications->posted().size();
    auto daemon = std::make_unique<QRVDaemon>(env_.services, QRVDaemon::Options{});
    env_.messages->beginTransaction();  // as the entry point does; start-up closes it
    daemon->quorvad_init();
    size_t expected = before + (daemon->isFirstBoot() ? 2 : 1);
    EXPECT_TRUE(QRVEventually([&] { return env_.notifications->posted().size() >= expected; }));
    // The cleanups hold transactions of their own for a while; the entry
    // point's one must be closed for the daemon ever to fall idle.
    EXPECT_TRUE(QRVEventually([&] { return env_.messages->isIdle(); }));
    return daemon;
  }

  QRVTestServices env_;
};

TEST_F(DaemonTest, FirstStartSinceBootRunsBootWorkOnceAndMarksIt) {
  auto first = startDaemon();
  EXPECT_TRUE(first->isFirstBoot());
  auto posted = env_.notifications->posted();
  EXPECT_NE(std::find(posted.begin(), posted.end(), kRebootCleanupCompleteNotification), posted.end());
  EXPECT_NE(std::find(posted.begin(), posted.end(), kCleanupCompleteNotification), posted.end());
  EXPECT_TRUE(env_.firstBootMarker->present);
  // The log was opened in the daemon's log directory.
  EXPECT_TRUE(std::filesystem::exists(env_.root.path() + "/private/var/root/Library/Logs/Quorva/quorvad.log"));

  // A second start in the same boot does only the ordinary cleanup.
  auto second = startDaemon();
  EXPECT_FALSE(second->isFirstBoot());
  ASSERT_EQ(env_.notifications->posted().size(), 3u);
  EXPECT_EQ(env_.notifications->posted().back(), kCleanupCompleteNotification);
  std::this_thread::sleep_for(std::chrono::milliseconds(50));
  EXPECT_EQ(env_.notifications->posted().size(), 3u);
}

TEST_F(DaemonTest, MarkerThatCannotBeCreatedMeansBootWorkRunsAgain) {
  env_.firstBootMarker->createError = EACCES;
  auto daemon = startDaemon();
  EXPECT_EQ(env_.notifications->posted().size(), 2u);
  EXPECT_FALSE(env_.firstBootMarker->present);
  EXPECT_TRUE(startDaemon()->isFirstBoot());
}

TEST_F(DaemonTest, LockStateSuspendsAndResumesTheQueueInBalance) {
  auto daemon = startDaemon();
  QRVSerialQueue& queue = *daemon->lockStateQueue();
  EXPECT_FALSE(queue.isSuspended());

  // An unlock with no lock before it changes nothing (a resume here would
  // abort: more resumes than suspensions).
  env_.lockState->state = 0;
  daemon->lockStateCallback();
  EXPECT_FALSE(queue.isSuspended());

  // Two locked notifications suspend once: one unlock resumes.
  env_.lockState->state = 1;
  daemon->lockStateCallback();
  daemon->lockStateCallback();
  EXPECT_TRUE(queue.isSuspended());
  // A transitional state leaves the queue as it is.
  env_.lockState->state = 2;
  daemon->lockStateCallback();
  EXPECT_TRUE(queue.isSuspended());
  env_.lockState->state = 0;
  daemon->lockStateCallback();
  EXPECT_FALSE(queue.isSuspended());
}

TEST_F(DaemonTest, StartsLockedWhenTheDeviceIsLockedAndFollowsNotifications) {
  env_.lockState->state = 1;
  auto daemon = startDaemon();
  EXPECT_TRUE(daemon->lockStateQueue()->isSuspended());
  // A change notification reaches the callback (on the main queue).
  env_.lockState->change(0);
  EXPECT_TRUE(QRVEventually([&] { return !daemon->lockStateQueue()->isSuspended(); }));
}

// A class change left by the previous run and restarted while the device is
// locked waits for the unlock (once: no retry runs while locked, so the
// application is not stopped yet), then finishes.
TEST_F(DaemonTest, AChangeRestartedWhileLockedFinishesAfterTheUnlock) {
  auto connection = QRVClientConnection::makeSharedClientConnection(env_.services);
  QRVError error;
  auto identity = QRVContainerIdentity::containerIdentityWithUserIdentity(
      env_.services->userIdentityCache->userIdentityForPersonalPersonaWithUID(501, 501), "com.example.app",
      QRVContainerClassAppData, &error);
  QRVMetadataRef container = connection->createOrLookupContainerWithContainerIdentity(identity, true, false, true, &error);
  ASSERT_NE(container, nullptr) << error.description();
  QRVWriteText(container->url() + "/Documents/a", "data");
  auto change = QRVDataProtectionChangeOperation::initWithContainerMetadata(
      container, 1, /*retryingIfLocked=*/true, QRVDataProtectionChangeOperation::kChangeDirectories,
      env_.services->dataProtectionManager->protectionOperationFileQueue(), env_.services);
  ASSERT_TRUE(change->writeToDiskWithError(&error)) << error.description();
  const std::string update = QRVDataProtectionChangeOperation::urlForProtectionOperationWithContainerIdentity(
      *container->containerIdentity(), *env_.services);

  env_.lockState->state = 1;
  auto daemon = std::make_unique<QRVDaemon>(env_.services, QRVDaemon::Options{});
  env_.messages->beginTransaction();
  daemon->quorvad_init();
  EXPECT_TRUE(daemon->lockStateQueue()->isSuspended());
  std::this_thread::sleep_for(std::chrono::milliseconds(100));
  const std::string log = QRVReadText(env_.root.path() + "/private/var/root/Library/Logs/Quorva/quorvad.log");
  size_t retries = 0;
  for (size_t at = log.find("Retrying container protection update"); at != std::string::npos;
       at = log.find("Retrying container protection update", at + 1))
    retries++;
  EXPECT_EQ(retries, 1u);
  EXPECT_TRUE(std::filesystem::exists(update));
  EXPECT_TRUE(env_.applicationTermination->terminated.empty());

  env_.lockState->change(0);
  EXPECT_TRUE(QRVEventually([&] { return !std::filesystem::exists(update); }));
  EXPECT_TRUE(QRVEventually([&] { return env_.messages->isIdle(); }));
  EXPECT_EQ(env_.applicationTermination->held, 0);
}

TEST_F(DaemonTest, FailedLockStateRegistrationStillAppliesTheCurrentState) {
  env_.lockState->registrationResult = 5;
  env_.lockState->state = 1;
  auto daemon = startDaemon();
  EXPECT_TRUE(daemon->lockStateQueue()->isSuspended());
  EXPECT_FALSE(env_.lockState->onChange);
}

TEST_F(DaemonTest, KeepAliveCoversAsynchronousJobs) {
  auto daemon = startDaemon();
  std::atomic<bool> release{false};
  env_.services->asyncWithKeepAlive(daemon->deathRowQueue(), [&] {
    while (!release) std::this_thread::sleep_for(std::chrono::milliseconds(1));
  });
  EXPECT_FALSE(env_.messages->isIdle());
  release = true;
  EXPECT_TRUE(QRVEventually([&] { return env_.messages->isIdle(); }));
}

TEST_F(DaemonTest, RootHeldByAnotherDaemonStopsStartBeforeAnythingRuns) {
  env_.instanceLock->heldElsewhere = true;
  QRVDaemon daemon(env_.services, QRVDaemon::Options{});
  EXPECT_EQ(daemon.start(), QRVDaemon::StartResult::kRootInUse);
  // Start-up was not even scheduled: it would have opened a transaction and
  // posted the cleanup notification.
  daemon.listenerQueue()->sync([] {});
  EXPECT_EQ(env_.messages->transactions, 0);
  EXPECT_TRUE(env_.notifications->posted().empty());
  EXPECT_FALSE(env_.firstBootMarker->present);
}

TEST_F(DaemonTest, FreeRootIsClaimedBeforeServing) {
  QRVDaemon daemon(env_.services, QRVDaemon::Options{});
  EXPECT_EQ(daemon.start(), QRVDaemon::StartResult::kServing);
  EXPECT_TRUE(env_.instanceLock->held);
  // Let start-up and its cleanups finish before the daemon goes away.
  EXPECT_TRUE(QRVEventually([&] { return env_.notifications->posted().size() >= 2; }));
  EXPECT_TRUE(QRVEventually([&] { return env_.messages->isIdle(); }));
}

TEST_F(DaemonTest, AConnectionArrivingDuringStartUpIsHandledAfterIt) {
  // A client that connects the moment the listener opens: the service hands
  // it to the listener queue, behind start-up.
  std::atomic<bool> handled{false}, startedFirst{false};
  env_.messages->onListen = [&](std::shared_ptr<QRVSerialQueue> queue, QRVMessageService::ConnectionHandler handler) {
    queue->async([&, handler] {
      // Start-up's last synchronous step subscribes to lock-state changes.
      startedFirst = static_cast<bool>(env_.lockState->onChange);
      handler(std::make_shared<QRVTestConnection>(42));
      handled = true;
    });
  };
  QRVDaemon daemon(env_.services, QRVDaemon::Options{});
  ASSERT_EQ(daemon.start(), QRVDaemon::StartResult::kServing);
  ASSERT_TRUE(QRVEventually([&] { return handled.load(); }));
  EXPECT_TRUE(startedFirst);
  EXPECT_TRUE(QRVEventually([&] { return env_.notifications->posted().size() >= 2; }));
  EXPECT_TRUE(QRVEventually([&] { return env_.messages->isIdle(); }));
}

}  // namespace

// The decisions above a class change: which class entitlements ask for, what
// a caller may ask for, which change a direction needs, the class recorded
// once a change has ended, the application kept stopped while a change waits
// for an unlock, and the changes a previous run left that start-up finishes.
#include "dataprotection/QRVDataProtectionManager.h"

#include <fcntl.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <future>

#include "base/QRVResultCode.h"
#include "codesigning/QRVCodeSigningMapping.h"
#include "core/QRVCommandQueue.h"
#include "support/QRVContainerTest.h"
#include "support/QRVLogCapture.h"

namespace fs = std::filesystem;
using Op = QRVDataProtectionChangeOperation;

namespace {

constexpr auto kWait = std::chrono::seconds(10);

class DataProtectionManagerTest : public QRVContainerTest {
 protected:
  QRVDataProtectionManager& manager() { return *env_.services->dataProtectionManager; }

  void install(const std::string& identifier, const QRVPlist& entitlements) {
    QRVPlist info = QRVPlist::dictionary().set(kQRVCodeSigningEntitlementsKey, entitlements);
    QRVCommandQueue queue;
    ASSERT_EQ(env_.services->codeSigningMapping->processCodeSigningInfo(info, identifier, QRVPlist(), queue), 1u);
    uint64_t result = 1;
    ASSERT_TRUE(queue.executeAllUntilExhaustedOrError(&result)) << result;
  }

  // The class the container's info records; nothing when none is.
  std::optional<uint32_t> recorded(const QRVContainerIdentityRef& id) {
    QRVError error;
    QRVMetadataRef m = lookup(id, &error);
    EXPECT_NE(m, nullptr) << error.description();
    return m ? QRVContentProtectionClassInInfo(m->info()) : std::nullopt;
  }
  void record(const QRVContainerIdentityRef& id, uint32_t c) {
    QRVError error;
    ASSERT_TRUE(admin()->setInfoValue(QRVPlist::uinteger(c), QRVPlist::string(kQRVContentProtectionClassKey), id,
                                      true, &error))
        << error.description();
  }

  // Starts a change; the future holds its result code once it has ended.
  std::future<uint64_t> start(const QRVContainerIdentityRef& id, int32_t protectionClass, bool thirdParty = false,
                              bool retry = true) {
    auto promise = std::make_shared<std::promise<uint64_t>>();
    manager().setDataProtectionOnDataContainerForContainerIdentity(
        id, protectionClass, thirdParty, retry, [promise](const QRVError* error) {
          promise->set_value(error ? error->code() : QRVResultCode::kSuccess);
        });
    return promise->get_future();
  }
  uint64_t set(const QRVContainerIdentityRef& id, int32_t protectionClass, bool thirdParty = false,
               bool retry = true) {
    std::future<uint64_t> done = start(id, protectionClass, thirdParty, retry);
    EXPECT_EQ(done.wait_for(kWait), std::future_status::ready);
    return done.get();
  }
  std::string updateURL(const QRVMetadataRef& m) {
    return Op::urlForProtectionOperationWithContainerIdentity(*m->containerIdentity(), *env_.services);
  }
  // Leaves an update file as a run that died before acting on it would.
  void leavePendingChange(const QRVMetadataRef& m, int32_t protectionClass, uint32_t changeType) {
    QRVError error;
    auto op = Op::initWithContainerMetadata(m, protectionClass, /*retryingIfLocked=*/true, changeType,
                                            manager().protectionOperationFileQueue(), env_.services);
    ASSERT_TRUE(op->writeToDiskWithError(&error)) << error.description();
  }
};

}  // namespace

// The first entitlement holding a string decides, by the names the platform
// gives its classes; anything else asks for nothing. New containers get the
// class their application asks for.
TEST_F(DataProtectionManagerTest, EntitlementsNameTheClassOfNewContainers) {
  using M = QRVDataProtectionManager;
  install("com.example.writeonly",
          QRVPlist::dictionary().set(M::kDataProtectionClassEntitlement, QRVPlist::string("KLFileProtectionWriteOnly")));
  install("com.example.ordered",
          QRVPlist::dictionary()
              .set(M::kDefaultDataProtectionEntitlement, QRVPlist::uinteger(4))  // not a string: skipped
              .set(M::kDataProtectionClassEntitlement, QRVPlist::string("KLFileProtectionComplete"))
              .set(M::kLegacyDataProtectionClassEntitlement, QRVPlist::string("KLFileProtectionNone")));
  install("com.example.first",
          QRVPlist::dictionary()
              .set(M::kDefaultDataProtectionEntitlement,
                   QRVPlist::string("KLFileProtectionCompleteUntilFirstUserAuthentication"))
              .set(M::kDataProtectionClassEntitlement, QRVPlist::string("KLFileProtectionComplete")));
  install("com.example.legacy", QRVPlist::dictionary().set(M::kLegacyDataProtectionClassEntitlement,
                                                           QRVPlist::string("KLFileProtectionNone")));
  install("com.example.unknown",
          QRVPlist::dictionary().set(M::kDataProtectionClassEntitlement, QRVPlist::string("NSFileProtectionComplete")));
  install("com.example.plain", QRVPlist::dictionary());

  QRVLogCapture log(env_.root.path());
  EXPECT_EQ(manager().intendedDataProtectionClassBasedOnEntitlementsForIdentifier("com.example.writeonly"), 2u);
  EXPECT_EQ(manager().intendedDataProtectionClassBasedOnEntitlementsForIdentifier("com.example.ordered"), 1u);
  EXPECT_EQ(manager().intendedDataProtectionClassBasedOnEntitlementsForIdentifier("com.example.first"), 3u);
  EXPECT_EQ(manager().intendedDataProtectionClassBasedOnEntitlementsForIdentifier("com.example.legacy"), 4u);
  EXPECT_EQ(manager().intendedDataProtectionClassBasedOnEntitlementsForIdentifier("com.example.unknown"), 0u);
  EXPECT_EQ(manager().intendedDataProtectionClassBasedOnEntitlementsForIdentifier("com.example.plain"), 0u);
  EXPECT_EQ(manager().intendedDataProtectionClassBasedOnEntitlementsForIdentifier("com.example.absent"), 0u);
  EXPECT_NE(log.text().find("Unknown value for DataProtectionClass entitlement: NSFileProtectionComplete; "
                            "defaulting to class 0"),
            std::string::npos);

  QRVMetadataRef created = create(identity("com.example.ordered"));
  ASSERT_NE(created, nullptr);
  EXPECT_EQ(classOf(created->url() + "/Documents"), 1u);
  EXPECT_EQ(classOf(created->url() + "/Library"), 1u);
}

// What a caller may ask for, and what a request that changes nothing does.
TEST_F(DataProtectionManagerTest, RefusedAndNeedlessRequestsChangeNothing) {
  QRVMetadataRef app = create(identity("com.example.app"));
  ASSERT_NE(app, nullptr);
  file(app->url() + "/Documents/a", 3);
  record(app->containerIdentity(), 3);

  EXPECT_EQ(set(identity("com.example.app", QRVContainerClassAppBundle), 4), QRVResultCode::kInvalidObject);
  EXPECT_EQ(set(identity("com.example.missing"), 4), QRVResultCode::kNoSuchContainer);
  EXPECT_EQ(set(app->containerIdentity(), 2), QRVResultCode::kInvalidInput);
  EXPECT_EQ(set(app->containerIdentity(), 4, /*thirdParty=*/true), QRVResultCode::kInvalidInput);
  EXPECT_EQ(classOf(app->url() + "/Documents/a"), 3u);
  EXPECT_EQ(recorded(app->containerIdentity()), 3u);

  // Asking for the class it has drops a change still waiting for an unlock,
  // which would otherwise undo the caller's wish later.
  leavePendingChange(app, 1, Op::kChangeDirectories | Op::kChangeFiles);
  ASSERT_TRUE(fs::exists(updateURL(app)));
  EXPECT_EQ(set(app->containerIdentity(), 3), QRVResultCode::kSuccess);
  EXPECT_FALSE(fs::exists(updateURL(app)));
  EXPECT_EQ(classOf(app->url() + "/Documents/a"), 3u);

  // The system's own applications may have class 4.
  EXPECT_EQ(set(app->containerIdentity(), 4), QRVResultCode::kSuccess);
  EXPECT_EQ(recorded(app->containerIdentity()), 4u);
  EXPECT_EQ(classOf(app->url() + "/Documents"), 4u);
}

// Lowering the class reaches the files; raising it only the directories, so
// that no file becomes weaker than it was.
TEST_F(DataProtectionManagerTest, TheDirectionOfAChangeDecidesWhetherFilesChange) {
  QRVMetadataRef app = create(identity("com.example.app"));
  ASSERT_NE(app, nullptr);
  const std::string f = app->url() + "/Documents/a";
  file(f, 3);
  record(app->containerIdentity(), 3);

  EXPECT_EQ(set(app->containerIdentity(), 1), QRVResultCode::kSuccess);
  EXPECT_EQ(classOf(f), 1u);
  EXPECT_EQ(classOf(app->url() + "/Documents"), 1u);
  EXPECT_EQ(recorded(app->containerIdentity()), 1u);

  EXPECT_EQ(set(app->containerIdentity(), 3), QRVResultCode::kSuccess);
  EXPECT_EQ(classOf(f), 1u) << "raising the class must leave files alone";
  EXPECT_EQ(classOf(app->url() + "/Documents"), 3u);
  EXPECT_EQ(recorded(app->containerIdentity()), 3u);

  // From no class at all to a strong one: the files too.
  QRVMetadataRef fresh = create(identity("com.example.fresh"));
  ASSERT_NE(fresh, nullptr);
  file(fresh->url() + "/Library/b", 3);
  EXPECT_EQ(set(fresh->containerIdentity(), 1), QRVResultCode::kSuccess);
  EXPECT_EQ(classOf(fresh->url() + "/Library/b"), 1u);
}

// A change that waits for an unlock keeps its application stopped from the
// retry until it has ended, and answers only then; without a retry it ends
// at once with 61 and records nothing.
TEST_F(DataProtectionManagerTest, AChangeWaitingForAnUnlockKeepsTheApplicationStopped) {
  QRVMetadataRef app = create(identity("com.example.app"));
  ASSERT_NE(app, nullptr);
  file(app->url() + "/Documents/a", 3);
  record(app->containerIdentity(), 3);

  env_.lockState->state = 1;
  EXPECT_EQ(set(app->containerIdentity(), 1, false, /*retry=*/false), QRVResultCode::kDeviceLocked);
  EXPECT_EQ(recorded(app->containerIdentity()), 3u);
  EXPECT_FALSE(fs::exists(updateURL(app)));

  env_.services->lockStateQueue->suspend();
  std::future<uint64_t> done = start(app->containerIdentity(), 1);
  EXPECT_EQ(done.wait_for(std::chrono::milliseconds(200)), std::future_status::timeout);
  EXPECT_TRUE(fs::exists(updateURL(app)));
  EXPECT_EQ(env_.applicationTermination->held, 0) << "nothing to keep stopped before the retry";

  // The retry starts, finds the device locked again (the lock came before
  // its notification), and waits once more: the application stays stopped.
  std::promise<void> retried;
  env_.services->lockStateQueue->async([&] {
    env_.services->lockStateQueue->suspend();
    retried.set_value();
  });
  env_.services->lockStateQueue->resume();
  retried.get_future().wait();
  EXPECT_EQ(env_.applicationTermination->held, 1);
  ASSERT_EQ(env_.applicationTermination->terminated.size(), 1u);
  EXPECT_EQ(env_.applicationTermination->terminated[0].rfind("com.example.app:", 0), 0u);

  env_.lockState->state = 0;
  env_.services->lockStateQueue->resume();
  ASSERT_EQ(done.wait_for(kWait), std::future_status::ready);
  EXPECT_EQ(done.get(), QRVResultCode::kSuccess);
  EXPECT_EQ(env_.applicationTermination->held, 0);
  EXPECT_EQ(env_.applicationTermination->terminated.size(), 1u) << "one stop for the whole change";
  EXPECT_EQ(classOf(app->url() + "/Documents/a"), 1u);
  EXPECT_EQ(recorded(app->containerIdentity()), 1u);
  EXPECT_FALSE(fs::exists(updateURL(app)));
}

// Start-up finishes every change a previous run left, and leaves behind (and
// logs) the files it cannot act on without giving up on the others.
TEST_F(DataProtectionManagerTest, StartUpFinishesPendingChangesAndLeavesBadFilesBehind) {
  QRVError error;
  EXPECT_TRUE(manager().restartPendingDataProtectionOperationsWithError(&error)) << "no directory is no work";

  QRVMetadataRef first = create(identity("com.example.first"));
  QRVMetadataRef second = create(identity("com.example.second"));
  QRVMetadataRef gone = create(identity("com.example.gone"));
  ASSERT_TRUE(first && second && gone);
  file(first->url() + "/Documents/a", 3);
  file(second->url() + "/Library/b", 3);
  leavePendingChange(first, 1, Op::kChangeDirectories | Op::kChangeFiles);
  leavePendingChange(second, 4, Op::kChangeDirectories);
  leavePendingChange(gone, 1, Op::kChangeDirectories);
  std::shared_ptr<QRVClientConnection> installer = admin();
  uint64_t result = 1;
  ASSERT_TRUE(installer->deleteContainerWithContainerIdentity(gone->containerIdentity(), false, &error) &&
              installer->completeWithError(&result))
      << error.description() << " " << result;
  const std::string pending = env_.services->globalConfiguration->pendingUpdatesDirectory();
  const std::string truncated = pending + "/com.example.truncated-2-x.plist";
  QRVWriteText(truncated, "bplist00\xd1");

  QRVLogCapture log(env_.root.path());
  EXPECT_TRUE(manager().restartPendingDataProtectionOperationsWithError(&error)) << error.description();
  EXPECT_EQ(classOf(first->url() + "/Documents/a"), 1u);
  EXPECT_EQ(classOf(second->url() + "/Library"), 4u);
  EXPECT_EQ(classOf(second->url() + "/Library/b"), 3u);
  EXPECT_EQ(recorded(first->containerIdentity()), 1u);
  EXPECT_EQ(recorded(second->containerIdentity()), 4u);
  EXPECT_FALSE(fs::exists(updateURL(first)));
  EXPECT_FALSE(fs::exists(updateURL(second)));
  EXPECT_TRUE(fs::exists(updateURL(gone)));
  EXPECT_TRUE(fs::exists(truncated));
  const std::string text = log.text();
  EXPECT_NE(text.find("Found pending data protection operation at " + updateURL(first)), std::string::npos);
  EXPECT_NE(text.find("Starting pending data protection update to protection class 4 for user: "),
            std::string::npos);
  EXPECT_NE(text.find("Failed to read data protection change operation at " + truncated), std::string::npos);
  EXPECT_NE(text.find("Failed to read data protection change operation at " + updateURL(gone)), std::string::npos);

  // A directory that cannot be listed is the one failure start-up reports.
  fs::remove_all(pending);
  QRVWriteText(pending, "not a directory");
  EXPECT_FALSE(manager().restartPendingDataProtectionOperationsWithError(&error));
  EXPECT_NE(log.text().find("Failed to get items at pendingUpdates URL " + pending), std::string::npos);
}

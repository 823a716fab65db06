#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>

#include "base/QRVLog.h"
#include "core/QRVDeleteHandlers.h"
#include "fs/QRVDictionaryAdditions.h"
#include "model/QRVContainerCache.h"
#include "operations/QRVApplicationTerminationAssertion.h"
#include "operations/QRVClientConnection.h"
#include "platform/linux/QRVLinuxApplicationTermination.h"
#include "support/QRVContainerTest.h"

namespace fs = std::filesystem;

namespace {

class ReplaceTest : public QRVContainerTest {
 protected:
  std::shared_ptr<QRVClientConnection> connection(const std::string& caller, bool unrestricted,
                                                  std::optional<QRVPlist::Array> wipe = std::nullopt) {
    return connectionFor(caller, {.allowOtherIdLookup = unrestricted, .unrestricted = unrestricted, .wipe = wipe});
  }
  uint64_t replaceCode(const QRVContainerIdentityRef& o, const QRVContainerIdentityRef& n, bool preserve = false) {
    QRVError error;
    bool replaced = admin()->replaceContainerIdentity(o, n, preserve, /*startDeletionThread=*/false, &error);
    return replaced ? 1 : error.code();
  }
  std::string replaceDir() { return env_.services->globalConfiguration->replaceDirectory(); }
};

TEST_F(ReplaceTest, ReplacePutsNewContentInPlaceAndLeavesNoJournal) {
  for (bool preserve : {false, true}) {
    SCOPED_TRACE(preserve ? "preserving the old UUID" : "taking the new UUID");
    auto app = identity(preserve ? "com.example.kept" : "com.example.app");
    auto old = create(app);
    QRVWriteText(old->url() + "/old.txt", "old");
    auto fresh = create(app, true);
    QRVWriteText(fresh->url() + "/new.txt", "new");

    ASSERT_EQ(replaceCode(old->containerIdentity(), fresh->containerIdentity(), preserve), 1u);
    // Kept, the old UUID keeps the old path; else the new UUID names it.
    const QRVUUID uuid = preserve ? old->uuid() : fresh->uuid();
    const std::string dest = fs::path(old->url()).parent_path().string() + "/" + uuid.string();
    EXPECT_EQ(QRVReadText(dest + "/new.txt"), "new");
    EXPECT_FALSE(fs::exists(dest + "/old.txt"));
    EXPECT_EQ(fs::exists(old->url()), preserve);
    EXPECT_FALSE(fs::exists(fresh->url()));
    EXPECT_EQ(QRVEntriesIn(replaceDir()), 0u);

    QRVError error;
    auto onDisk = QRVMetadata::readAndValidateMetadataAtUrl(dest, mobile(), true, *env_.services->fileManager,
                                                            *env_.services->userIdentityCache, &error);
    ASSERT_NE(onDisk, nullptr) << error.description();
    EXPECT_EQ(onDisk->uuid(), uuid);
    auto found = lookup(app, &error);
    ASSERT_NE(found, nullptr) << error.description();
    EXPECT_EQ(found->uuid(), uuid);
    EXPECT_EQ(found->url(), dest);
  }
  // The old directories went to death row, not away.
  EXPECT_GE(QRVEntriesIn(env_.services->globalConfiguration->deathrowDirectory()), 2u);
}

TEST_F(ReplaceTest, EachCheckAnswersItsCodeAndMovesNothing) {
  auto a = create(identity("com.example.app")), b = create(identity("com.example.other"));
  auto p = create(identity("com.example.plugin", QRVContainerClassPluginData));
  QRVWriteText(a->url() + "/keep.txt", "a");

  QRVError error;
  auto elsewhere = QRVConcreteContainerIdentity::containerIdentityWithUUID(
      b->uuid(),
      QRVUserIdentity::make(502, 502, env_.root.path() + "/private/var/other", "", QRVPersonaTypePersonal, 502),
      "com.example.other", QRVContainerClassAppData, &error);
  ASSERT_NE(elsewhere, nullptr) << error.description();
  auto ghost = QRVConcreteContainerIdentity::containerIdentityWithUUID(QRVUUID::random(), mobile(), "com.example.ghost",
                                                                       QRVContainerClassAppData, &error);
  EXPECT_EQ(replaceCode(nullptr, b->containerIdentity()), 38u);
  EXPECT_EQ(replaceCode(a->containerIdentity(), identity("com.example.other")), 11u);  // no UUID on the new side
  EXPECT_EQ(replaceCode(identity("com.example.app"), b->containerIdentity(), true), 11u);  // preserving, no old UUID
  EXPECT_EQ(replaceCode(a->containerIdentity(), p->containerIdentity()), 23u);
  EXPECT_EQ(replaceCode(a->containerIdentity(), a->containerIdentity()), 22u);
  EXPECT_EQ(replaceCode(a->containerIdentity(), elsewhere), 76u);  // same identifier, another user
  EXPECT_EQ(replaceCode(a->containerIdentity(), ghost), 21u);
  // A live new container already sits at its own destination.
  EXPECT_EQ(replaceCode(a->containerIdentity(), b->containerIdentity()), 27u);

  EXPECT_EQ(QRVReadText(a->url() + "/keep.txt"), "a");
  EXPECT_TRUE(fs::exists(b->url()));
  EXPECT_EQ(QRVEntriesIn(replaceDir()), 0u);
}

class RecoveryTest : public ReplaceTest {
 protected:
  void SetUp() override {
    ReplaceTest::SetUp();
    if (IsSkipped()) return;
    // The places a real replace of the mobile user's application data uses.
    QRVGlobalConfiguration& config = *env_.services->globalConfiguration;
    live_ = *config.containerDirectoryURLForUserIdentity(mobile(), QRVContainerClassAppData, false);
    stagingParent_ = config.stagingDirectoryURLForUserIdentity(mobile(), QRVContainerClassAppData);
    oldURL_ = live_ + "/" + QRVUUID::random().string();
    staging_ = stagingParent_ + "/" + QRVUUID::random().string();
    dest_ = live_ + "/" + QRVUUID::random().string();
    newURL_ = *config.containerDirectoryURLForUserIdentity(mobile(), QRVContainerClassAppData, true) + "/" +
              QRVUUID::random().string();
    fs::create_directories(replaceDir());
  }
  void writeJournal(const std::string& name = "j") { writeJournal(name, oldURL_, newURL_, staging_, dest_); }
  void writeJournal(const std::string& name, const std::string& o, const std::string& n, const std::string& s,
                    const std::string& d) {
    QRVError error;
    ASSERT_TRUE(admin()->TEST_writeToDiskReplaceAt(replaceDir() + "/" + name + ".plist", o, n, s, d, &error))
        << error.description();
  }
  void marked(const std::string& dir, const std::string& mark) {
    fs::create_directories(dir);
    QRVWriteText(dir + "/mark", mark);
  }
  void recover() {
    QRVError error;
    ASSERT_TRUE(admin()->TEST_recoverFromReplaceOperationsWithError(&error)) << error.description();
    EXPECT_EQ(QRVEntriesIn(replaceDir()), 0u);
  }

  std::string live_, stagingParent_;
  std::string oldURL_, staging_, dest_, newURL_;
};

TEST_F(RecoveryTest, EachOfTheFourStatesEndsWithOneContainerInPlace) {
  // Not started: the old directory is still in place.
  marked(oldURL_, "old");
  marked(newURL_, "new");
  writeJournal();
  recover();
  EXPECT_EQ(QRVReadText(oldURL_ + "/mark"), "old");
  EXPECT_EQ(QRVReadText(newURL_ + "/mark"), "new");
  EXPECT_FALSE(fs::exists(staging_));

  // Old parked in staging: it is put back.
  fs::rename(oldURL_, staging_);
  writeJournal();
  recover();
  EXPECT_EQ(QRVReadText(oldURL_ + "/mark"), "old");
  EXPECT_FALSE(fs::exists(staging_));

  // New at the destination: nothing moves; staging is left for cleanup.
  fs::rename(oldURL_, staging_);
  fs::rename(newURL_, dest_);
  writeJournal();
  recover();
  EXPECT_EQ(QRVReadText(dest_ + "/mark"), "new");
  EXPECT_EQ(QRVReadText(staging_ + "/mark"), "old");
  EXPECT_FALSE(fs::exists(oldURL_));
}

TEST_F(RecoveryTest, BootSetUpRunsTheRecoveryAndNoReplaceDirectoryIsNothingToDo) {
  marked(staging_, "old");
  writeJournal();
  const std::string logPath = env_.root.path() + "/recovery.log";
  ASSERT_TRUE(QRVLog::open("test", logPath, QRVLogLevel::kDebug, 2, 1 << 20));
  admin()->quorvaSetup();
  QRVLog::close();
  EXPECT_EQ(QRVReadText(oldURL_ + "/mark"), "old");
  EXPECT_EQ(QRVEntriesIn(replaceDir()), 0u);
  // The log shows what the journal said, not only where it was.
  const std::string log = QRVReadText(logPath);
  EXPECT_NE(log.find("Doing a replace of " + replaceDir() + "/j.plist with info: "), std::string::npos) << log;
  EXPECT_NE(log.find(staging_, log.find("with info: ")), std::string::npos) << log;

  fs::remove_all(replaceDir());
  QRVError error;
  EXPECT_TRUE(admin()->TEST_recoverFromReplaceOperationsWithError(&error)) << error.description();
}

TEST_F(RecoveryTest, UnreadableOrIncompleteJournalsAreDiscardedWithoutAMove) {
  marked(staging_, "old");
  QRVWriteText(replaceDir() + "/garbage.plist", "this is not a property list");
  QRVPlist partial = QRVPlist::dictionary()
                         .set("QRVReplaceOperationOldURL", QRVPlist::string(oldURL_))
                         .set("QRVReplaceOperationStagingURL", QRVPlist::string(staging_))
                         .set("QRVReplaceOperationDestURL", QRVPlist::string(dest_));
  QRVError error;
  ASSERT_TRUE(QRV_writeToURL(*env_.services->fileManager, partial, replaceDir() + "/partial.plist", &error));
  ASSERT_TRUE(QRV_writeToURL(*env_.services->fileManager, QRVPlist::array(), replaceDir() + "/array.plist", &error));

  for (const char* name : {"/partial.plist", "/garbage.plist"}) {
    EXPECT_FALSE(admin()->TEST_readAndValidateReplaceFileAtUrl(replaceDir() + name, &error));
    EXPECT_EQ(error.code(), 35u) << name;
  }
  EXPECT_FALSE(admin()->TEST_writeToDiskReplaceAt(replaceDir() + "/x.plist", oldURL_, "", staging_, dest_, &error));
  EXPECT_EQ(error.code(), 33u);

  recover();
  EXPECT_FALSE(fs::exists(oldURL_));
  EXPECT_EQ(QRVReadText(staging_ + "/mark"), "old");
}

TEST_F(RecoveryTest, AJournalWithNothingLeftToMoveBackIsDiscardedAndTheOthersStillRun) {
  // One journal names nothing that exists any more; another names an old
  // container parked in staging. Whatever order they are read in, the first
  // must not stop the recovery of the second.
  writeJournal("empty");
  const std::string otherOld = live_ + "/" + QRVUUID::random().string();
  const std::string otherStaging = stagingParent_ + "/" + QRVUUID::random().string();
  marked(otherStaging, "parked");
  writeJournal("parked", otherOld, newURL_, otherStaging, live_ + "/" + QRVUUID::random().string());
  recover();
  EXPECT_EQ(QRVReadText(otherOld + "/mark"), "parked");
  EXPECT_FALSE(fs::exists(otherStaging));
  EXPECT_FALSE(fs::exists(oldURL_));
}

TEST_F(RecoveryTest, AFailedMoveBackStopsRecoveryAndTheCleanupKeepsWhatJournalsName) {
  marked(staging_, "parked");
  writeJournal();
  // The move back fails, once.
  env_.posixFileSystem->failNext(QRVFaultInjectionFileSystem::Operation::kRename, EIO, staging_);
  // A staging leftover no journal names.
  const std::string leftover = stagingParent_ + "/" + QRVUUID::random().string();
  marked(leftover, "leftover");

  QRVError error;
  EXPECT_FALSE(admin()->TEST_recoverFromReplaceOperationsWithError(&error));
  EXPECT_EQ(error.code(), 35u);
  EXPECT_EQ(QRVEntriesIn(replaceDir()), 1u);

  std::promise<void> done;
  admin()->quorvaCleanupWithCompletion([&] { done.set_value(); });
  ASSERT_EQ(done.get_future().wait_for(std::chrono::seconds(10)), std::future_status::ready);
  EXPECT_EQ(QRVReadText(staging_ + "/mark"), "parked");
  EXPECT_FALSE(fs::exists(leftover));

  // A journal that cannot be read says nothing of what it protects: the
  // cleanup leaves staging alone.
  QRVWriteText(replaceDir() + "/garbage.plist", "not a property list");
  marked(leftover, "leftover");
  std::promise<void> again;
  admin()->quorvaCleanupWithCompletion([&] { again.set_value(); });
  ASSERT_EQ(again.get_future().wait_for(std::chrono::seconds(10)), std::future_status::ready);
  EXPECT_EQ(QRVReadText(staging_ + "/mark"), "parked");
  EXPECT_EQ(QRVReadText(leftover + "/mark"), "leftover");

  // The next start puts the old container back.
  fs::remove(replaceDir() + "/garbage.plist");
  recover();
  EXPECT_EQ(QRVReadText(oldURL_ + "/mark"), "parked");
}

TEST_F(RecoveryTest, JournalsNamingPlacesOutsideTheirTreesAreDiscardedWithoutAMove) {
  // A directory outside the root that must never be moved or filled.
  QRVTemporaryDirectory outside;
  const std::string sentinel = outside.path() + "/" + QRVUUID::random().string();
  marked(sentinel, "outside");
  // A link inside the container tree that leads out of it.
  const std::string escape = live_ + "/escape";
  fs::create_directories(live_);
  fs::create_directory_symlink(outside.path(), escape);
  const std::string uuid = QRVUUID::random().string();
  marked(staging_, "parked");

  struct {
    const char* what;
    std::string old, staging, dest;
  } cases[] = {
      {"the root of the file system as the parked directory", oldURL_, "/", dest_},
      {"the root of the file system as the old place", "/", staging_, dest_},
      {"a parked directory outside the root", oldURL_, sentinel, dest_},
      {"an old place outside the root", outside.path() + "/" + uuid, staging_, dest_},
      {"'..' climbing out of the container tree", live_ + "/../../../../../../../../" + uuid, staging_, dest_},
      {"'..' climbing out of staging", oldURL_, stagingParent_ + "/../" + uuid, dest_},
      {"a link in the container tree leading out", escape + "/" + uuid, staging_, dest_},
      {"a parked directory that is itself a link", oldURL_, stagingParent_ + "/" + uuid, dest_},
      {"a destination in staging", oldURL_, staging_, stagingParent_ + "/" + uuid},
      {"a parked directory not directly in staging", oldURL_, live_ + "/" + uuid, dest_},
  };
  fs::create_directory_symlink(outside.path(), stagingParent_ + "/" + uuid);
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    writeJournal("bad", c.old, newURL_, c.staging, c.dest);
    QRVError error;
    EXPECT_FALSE(admin()->TEST_readAndValidateReplaceFileAtUrl(replaceDir() + "/bad.plist", &error));
    EXPECT_EQ(error.code(), 35u);
    recover();
    EXPECT_EQ(QRVReadText(sentinel + "/mark"), "outside");
    EXPECT_EQ(QRVEntriesIn(outside.path()), 1u);
    EXPECT_EQ(QRVReadText(staging_ + "/mark"), "parked");
    EXPECT_FALSE(fs::exists(oldURL_));
  }
  // The same journal naming the daemon's own places is followed.
  writeJournal();
  recover();
  EXPECT_EQ(QRVReadText(oldURL_ + "/mark"), "parked");
}

TEST_F(ReplaceTest, WipeKeepsUUIDAndPathAndLeavesOnlyTheDefaultStructure) {
  auto app = identity("com.example.app");
  auto old = create(app);
  QRVWriteText(old->url() + "/old.txt", "old");
  // A data container's default structure, written out rather than read
  // from the table the wipe itself uses.
  const std::vector<std::string> subdirectories = {"Documents", "Library", "Library/Caches", "Library/Preferences",
                                                   "SystemData", "tmp"};
  QRVWriteText(old->url() + "/" + subdirectories.front() + "/deep.txt", "old");

  // Refused outside the caller's list, without a list, and for other classes.
  QRVError error;
  auto notListed = connection("com.example.settings", false, QRVPlist::Array{QRVPlist::string("com.example.other")});
  EXPECT_FALSE(notListed->deleteDataContainerContentWithContainerIdentity(app, &error));
  EXPECT_EQ(error.code(), 55u);
  EXPECT_FALSE(connection("com.example.settings", false)->deleteDataContainerContentWithContainerIdentity(app, &error));
  EXPECT_EQ(error.code(), 55u);
  EXPECT_FALSE(admin()->deleteDataContainerContentWithContainerIdentity(
      identity("com.example.app", QRVContainerClassAppBundle, env_.services->userIdentityCache->defaultUserIdentity()),
      &error));
  EXPECT_EQ(error.code(), 11u);
  EXPECT_EQ(QRVReadText(old->url() + "/old.txt"), "old");

  auto client = connection("com.example.settings", false, QRVPlist::Array{QRVPlist::string("com.example.app")});
  ASSERT_TRUE(client->deleteDataContainerContentWithContainerIdentity(app, &error)) << error.description();
  EXPECT_FALSE(client->isUnrestricted());  // widened only for the wipe itself
  auto found = lookup(app, &error);
  ASSERT_NE(found, nullptr) << error.description();
  EXPECT_EQ(found->uuid(), old->uuid());
  EXPECT_EQ(found->url(), old->url());
  EXPECT_FALSE(fs::exists(old->url() + "/old.txt"));
  for (const std::string& name : subdirectories) {
    EXPECT_TRUE(fs::is_directory(old->url() + "/" + name)) << name;
    // Only the default structure nested below it, nothing of the old content.
    for (const auto& entry : fs::directory_iterator(old->url() + "/" + name)) {
      std::string relative = name + "/" + entry.path().filename().string();
      EXPECT_NE(std::find(subdirectories.begin(), subdirectories.end(), relative), subdirectories.end()) << relative;
    }
  }
  EXPECT_EQ(QRVEntriesIn(replaceDir()), 0u);
}

TEST_F(ReplaceTest, OnlyDataContainersAreWiped) {
  // Data containers of every kind come back empty under their own UUID.
  for (QRVContainerClass c : {2, 4, 6, 9, 10, 11}) {
    SCOPED_TRACE(c);
    auto id = identity("com.example.data", c);
    auto old = create(id);
    ASSERT_NE(old, nullptr);
    QRVWriteText(old->url() + "/old.txt", "old");
    QRVError error;
    ASSERT_TRUE(admin()->deleteDataContainerContentWithContainerIdentity(id, &error)) << error.description();
    EXPECT_FALSE(fs::exists(old->url() + "/old.txt"));
    auto found = lookup(id, &error);
    ASSERT_NE(found, nullptr) << error.description();
    EXPECT_EQ(found->uuid(), old->uuid());
  }
  // Bundles, groups and system containers are not, and keep their content.
  for (QRVContainerClass c : {1, 3, 7, 12, 13}) {
    SCOPED_TRACE(c);
    auto id = identity("com.example.other", c);
    auto kept = create(id);
    ASSERT_NE(kept, nullptr);
    QRVWriteText(kept->url() + "/kept.txt", "kept");
    QRVError error;
    EXPECT_FALSE(admin()->deleteDataContainerContentWithContainerIdentity(id, &error));
    EXPECT_EQ(error.code(), 11u);
    EXPECT_EQ(QRVReadText(kept->url() + "/kept.txt"), "kept");
  }
}

TEST_F(ReplaceTest, DeleteCommandsStageThroughTheQueue) {
  auto app = identity("com.example.app");
  auto a = create(app), b = create(identity("com.example.other"));
  auto client = admin();
  auto uuidData = [](const QRVUUID& u) { return QRVPlist::data(QRVPlist::Bytes(u.bytes().begin(), u.bytes().end())); };

  // Arrays of lengths 2, 2, 2, 1: refused, nothing queued.
  QRVPlist request =
      QRVPlist::dictionary()
          .set("ContainerClassesArray", QRVPlist::array({QRVPlist::uinteger(2), QRVPlist::uinteger(2)}))
          .set("UUIDsArray", QRVPlist::array({uuidData(a->uuid()), uuidData(b->uuid())}))
          .set("IdentifiersArray",
               QRVPlist::array({QRVPlist::string("com.example.app"), QRVPlist::string("com.example.other")}))
          .set("PersonaUniqueStringsArray", QRVPlist::array({QRVPlist::string("")}));
  uint64_t result = 1;
  QRVHandleStageContainerForDelete(request, nullptr, *client, &result);
  EXPECT_EQ(result, 38u);
  EXPECT_EQ(client->commandQueue().pendingCount(), 0u);
  EXPECT_TRUE(fs::exists(a->url()));

  // Equal lengths: one command, which removes both when the queue drains.
  request.set("PersonaUniqueStringsArray", QRVPlist::array({QRVPlist::string(""), QRVPlist::string("")}));
  result = 1;
  QRVHandleStageContainerForDelete(request, nullptr, *client, &result);
  EXPECT_EQ(result, 1u);
  EXPECT_EQ(client->commandQueue().pendingCount(), 1u);
  EXPECT_TRUE(client->completeWithError(&result));
  EXPECT_FALSE(fs::exists(a->url()));
  EXPECT_FALSE(fs::exists(b->url()));

  // deleteContainer: a look-up, then the same staged deletion.
  auto c = create(app);
  QRVError error;
  ASSERT_TRUE(client->deleteContainerWithContainerIdentity(app, false, &error)) << error.description();
  EXPECT_TRUE(fs::exists(c->url()));
  EXPECT_TRUE(client->completeWithError(&result));
  EXPECT_FALSE(fs::exists(c->url()));
  EXPECT_FALSE(client->deleteContainerWithContainerIdentity(app, false, &error));
  EXPECT_EQ(error.code(), 21u);
}

TEST(ApplicationTerminationTest, AssertionHoldsUntilInvalidatedAndChecksTheReason) {
  auto service = std::make_shared<QRVFakeApplicationTermination>();
  {
    QRVApplicationTerminationAssertion assertion(service, "com.example.app", 1);
    EXPECT_TRUE(assertion.isHeld());
    EXPECT_EQ(service->held, 1);
    assertion.invalidate();
    EXPECT_EQ(service->held, 0);
  }
  service->refuse = true;
  EXPECT_FALSE(QRVApplicationTerminationAssertion(service, "com.example.app", 0).isHeld());
  EXPECT_FALSE(QRVApplicationTerminationAssertion(nullptr, "com.example.app", -1).isHeld());

  EXPECT_DEATH(QRVApplicationTerminationAssertion(service, "com.example.app", 7), "");
  EXPECT_DEATH(
      {
        service->refuse = false;
        QRVApplicationTerminationAssertion leaked(service, "com.example.app", 1);
      },
      "");
}

TEST(ApplicationTerminationTest, LinuxFreezesAndKillsTheScopeWhileHeld) {
  QRVTemporaryDirectory slice;
  const std::string scope = slice.path() + "/app-com.example.app.scope";
  fs::create_directories(scope);
  QRVWriteText(scope + "/cgroup.freeze", "0");
  QRVWriteText(scope + "/cgroup.kill", "");

  QRVLinuxApplicationTermination termination(slice.path());
  QRVError error;
  auto held = termination.terminate("com.example.app", "container change", &error);
  ASSERT_NE(held, nullptr) << error.description();
  EXPECT_EQ(QRVReadText(scope + "/cgroup.freeze"), "1");
  EXPECT_EQ(QRVReadText(scope + "/cgroup.kill"), "1");
  held.reset();
  EXPECT_EQ(QRVReadText(scope + "/cgroup.freeze"), "0");

  // No cgroup: nothing runs, nothing to stop.
  EXPECT_NE(termination.terminate("com.example.absent", "container change", &error), nullptr);
  EXPECT_FALSE(fs::exists(slice.path() + "/app-com.example.absent.scope"));
  EXPECT_EQ(termination.terminate("../escape", "container change", &error), nullptr);
}

}  // namespace

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

#include "base/QRVLog.h"
#include "model/QRVContainerCache.h"
#include "operations/QRVClientConnection.h"
#include "support/QRVContainerTest.h"

namespace fs = std::filesystem;

namespace {

class GrantsOneGroup : public QRVNoSystemGroupQueries {
 public:
  std::vector<std::string> systemGroupIdentifiersForIdentifier(const std::string& id) override {
    if (id == "com.example.daemon") return {"systemgroup.com.example.shared", "systemgroup.com.example.absent"};
    return {};
  }
};

// The daemon of the shared-content tests has a system container of its own.
class SaysHasSystemContainer : public QRVNoCodeSigningQueries {
 public:
  bool identifierHasSystemContainer(const std::string& id) override { return id == "com.example.daemon"; }
};

void writeFile(const std::string& path, size_t bytes) {
  std::ofstream out(path, std::ios::binary);
  std::string block(4096, 'x');
  for (size_t written = 0; written < bytes; written += block.size()) out.write(block.data(), block.size());
}

QRVPlist key(const std::string& k) { return QRVPlist::string(k); }

class ContentsTest : public QRVContainerTest {
 protected:
  std::shared_ptr<QRVClientConnection> connectionFor(const std::string& caller, bool entitled = true) {
    return QRVContainerTest::connectionFor(caller, {.entitled = entitled});
  }
  // The assets path as `by` (default the installer) asks for it; a failure
  // leaves its error in error_.
  std::optional<std::string> assets(const QRVContainerIdentityRef& id, bool relative, bool createIfNecessary,
                                    std::shared_ptr<QRVClientConnection> by = nullptr) {
    error_ = QRVError();
    return (by ? by : admin())
        ->userManagedAssetsPathWithContainerIdentity(id, relative, createIfNecessary, &existed_, &error_);
  }
  QRVError error_;
  bool existed_ = false;
};

TEST_F(ContentsTest, InfoValuesAreSetReadAndRemovedAndSurviveAFreshCache) {
  const std::string logPath = env_.root.path() + "/info.log";
  ASSERT_TRUE(QRVLog::open("test", logPath, QRVLogLevel::kNotice, 2, 1 << 20));
  auto app = identity("com.example.app");
  QRVError error;
  EXPECT_FALSE(admin()->setInfoValue(QRVPlist::string("v"), key("k"), app, true, &error));
  EXPECT_EQ(error.code(), 21u);
  create(app);

  ASSERT_TRUE(admin()->setInfoValue(QRVPlist::string("v"), key("k"), app, true, &error)) << error.description();
  ASSERT_TRUE(admin()->setInfoValue(QRVPlist::uinteger(7), key("n"), app, true, &error));
  freshCache();
  EXPECT_EQ(admin()->infoValueForKey(key("k"), app, true, &error), QRVPlist::string("v")) << error.description();
  EXPECT_EQ(admin()->infoValueForKey(key("n"), app, false, &error), QRVPlist::uinteger(7));

  // Setting nothing removes the key, on disk too.
  ASSERT_TRUE(admin()->removeInfoValueForKey(key("k"), app, true, &error));
  freshCache();
  EXPECT_FALSE(admin()->infoValueForKey(key("k"), app, true, &error).has_value());
  EXPECT_EQ(error.code(), 24u);
  EXPECT_EQ(admin()->infoValueForKey(key("n"), app, true, &error), QRVPlist::uinteger(7));

  // Keys must be strings.
  EXPECT_FALSE(admin()->infoValueForKey(QRVPlist::uinteger(1), app, true, &error).has_value());
  EXPECT_EQ(error.code(), 38u);
  EXPECT_FALSE(admin()->setInfoValue(QRVPlist::string("v"), QRVPlist(), app, true, &error));
  EXPECT_EQ(error.code(), 38u);

  // A missing container or value is the caller's mistake, and the log says
  // which; a plain look-up that finds nothing stays out of the error log.
  QRVLog::close();
  std::stringstream log;
  log << std::ifstream(logPath).rdbuf();
  EXPECT_NE(log.str().find("No Container with identity: <QRVContainerIdentity"), std::string::npos) << log.str();
  EXPECT_NE(log.str().find("Didn't find info value for key: k"), std::string::npos) << log.str();
  EXPECT_EQ(log.str().find("Container Not Found with ID"), std::string::npos) << log.str();
}

TEST_F(ContentsTest, ConcurrentWritersOfDifferentKeysKeepBothValues) {
  auto app = identity("com.example.app");
  create(app);
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; t++)
    threads.emplace_back([&, t] {
      for (int i = 0; i < 10; i++) {
        QRVError e;
        EXPECT_TRUE(admin()->setInfoValue(QRVPlist::uinteger(i), key("key" + std::to_string(t)), app, true, &e));
      }
    });
  for (auto& t : threads) t.join();
  freshCache();
  QRVError error;
  for (int t = 0; t < 4; t++)
    EXPECT_EQ(admin()->infoValueForKey(key("key" + std::to_string(t)), app, true, &error), QRVPlist::uinteger(9));
}

TEST_F(ContentsTest, AssetsPathIsCreatedOnceOwnedByTheUserAndAnsweredRelativeOrAbsolute) {
  auto app = identity("com.example.app");
  EXPECT_FALSE(assets(app, false, false));
  EXPECT_EQ(error_.code(), 21u);
  // Asked to create, it makes the application data container as well.
  existed_ = true;
  auto path = assets(app, false, true);
  ASSERT_TRUE(path.has_value()) << error_.description();
  EXPECT_FALSE(existed_);
  QRVError error;
  auto container = admin()->metadataWithContainerIdentity(app, &error);
  ASSERT_NE(container, nullptr) << error.description();
  const std::string name = fs::path(*path).filename().string();
  EXPECT_EQ(*path, container->url() + "/" + name);
  EXPECT_EQ(name.rfind("com.kelva.UserManagedAssets.", 0), 0u) << name;
  struct stat st;
  ASSERT_EQ(statThroughSeam(*path, &st), 0);
  EXPECT_TRUE(S_ISDIR(st.st_mode));
  EXPECT_EQ(st.st_uid, 501u);
  EXPECT_EQ(st.st_gid, 501u);
  EXPECT_EQ(st.st_mode & 07777, 0755u);

  // The name is in the metadata file: a fresh cache answers the same.
  freshCache();
  EXPECT_EQ(assets(app, true, true), name) << error_.description();
  EXPECT_TRUE(existed_);

  // Without the entitlement only one's own identifier.
  EXPECT_EQ(assets(app, true, false, connectionFor("com.example.app", false)), name);
  EXPECT_FALSE(assets(app, true, false, connectionFor("com.example.other", false)));
  EXPECT_EQ(error_.code(), 38u);

  // A container without the directory is not given one by a mere look-up.
  auto plain = identity("com.example.plain");
  create(plain);
  EXPECT_FALSE(assets(plain, false, false));
  EXPECT_EQ(error_.code(), 71u);
}

class AssetDeletionTest : public ContentsTest {
 protected:
  void SetUp() override {
    ContentsTest::SetUp();
    if (IsSkipped()) return;
    app_ = identity("com.example.app");
    container_ = create(app_);
    assets_ = assets(app_, false, true).value_or("");
    ASSERT_FALSE(assets_.empty()) << error_.description();
    // Outside the container entirely, and inside it but outside the assets.
    outside_ = env_.root.path() + "/victim";
    writeFile(outside_, 10);
    writeFile(container_->url() + "/Documents/precious", 10);
    fs::create_directories(assets_ + "/sub/deeper");
    writeFile(assets_ + "/sub/deeper/file", 10);
    writeFile(assets_ + "/file", 10);
    fs::create_symlink("../Documents", assets_ + "/climb");
    fs::create_symlink(outside_, assets_ + "/absolute");
    fs::create_symlink("sub/deeper/file", assets_ + "/inner");
  }
  uint64_t remove(const std::string& relativePath, const QRVContainerIdentityRef& id = nullptr) {
    QRVError error;
    return admin()->deleteUserManagedAssetWithContainerIdentity(id ? id : app_, relativePath, &error) ? 1
                                                                                                      : error.code();
  }
  void expectNothingOutsideTouched() {
    EXPECT_TRUE(fs::exists(outside_));
    EXPECT_TRUE(fs::exists(container_->url() + "/Documents/precious"));
    EXPECT_TRUE(fs::is_directory(assets_));
  }

  QRVContainerIdentityRef app_;
  QRVMetadataRef container_;
  std::string assets_, outside_;
};

TEST_F(AssetDeletionTest, RemovesOnlyWhatLiesInsideTheAssetsDirectory) {
  // The directory itself, anything outside it, through links or not, and
  // what is not a relative path at all.
  for (const char* path : {".", "./", "sub/..", "..", "../Documents/precious", "climb", "climb/precious", "absolute"})
    EXPECT_EQ(remove(path), 10u) << path;
  EXPECT_EQ(remove(""), 11u);
  EXPECT_EQ(remove(outside_), 11u);
  expectNothingOutsideTouched();
  EXPECT_TRUE(fs::is_symlink(assets_ + "/climb"));
  EXPECT_TRUE(fs::is_symlink(assets_ + "/absolute"));

  EXPECT_EQ(remove("file"), 1u);
  EXPECT_FALSE(fs::exists(assets_ + "/file"));
  EXPECT_EQ(remove("sub/"), 1u);
  EXPECT_FALSE(fs::exists(assets_ + "/sub"));
  expectNothingOutsideTouched();
}

TEST_F(AssetDeletionTest, AMissingAssetIsAnErrorNotASuccess) {
  // The client would believe gone an asset it only misnamed.
  EXPECT_EQ(remove("nothing-here"), 10u);
  EXPECT_EQ(remove("sub/nothing/here"), 10u);
  EXPECT_EQ(remove("file/below-a-file"), 10u);
  // A link whose target is gone names nothing either.
  fs::create_symlink("gone", assets_ + "/dangling");
  EXPECT_EQ(remove("dangling"), 10u);
  EXPECT_TRUE(fs::is_symlink(assets_ + "/dangling"));
  EXPECT_TRUE(fs::exists(assets_ + "/file"));
}

TEST_F(AssetDeletionTest, WhatIsRemovedIsTheResolvedItemInsideTheDirectory) {
  // A nested asset, by its own path and through a link to it.
  writeFile(assets_ + "/sub/deeper/second", 10);
  EXPECT_EQ(remove("sub/deeper/second"), 1u);
  EXPECT_FALSE(fs::exists(assets_ + "/sub/deeper/second"));
  EXPECT_EQ(remove("inner"), 1u);
  EXPECT_FALSE(fs::exists(assets_ + "/sub/deeper/file"));
  EXPECT_TRUE(fs::is_directory(assets_ + "/sub/deeper"));

  // Links that resolve out of the directory, by any route, and ".." in the
  // path, even when it would come back inside.
  fs::create_symlink("..", assets_ + "/sub/deeper/up");
  fs::create_symlink("../../..", assets_ + "/sub/out");
  fs::create_symlink(container_->url() + "/Documents", assets_ + "/docs");
  for (const char* path : {"sub/deeper/up/../../Documents/precious", "sub/out", "sub/out/Documents/precious", "docs",
                           "docs/precious", "sub/../file", "sub/deeper/../../file", "../" /* the container */})
    EXPECT_EQ(remove(path), 10u) << path;
  expectNothingOutsideTouched();
  EXPECT_TRUE(fs::exists(assets_ + "/file"));
  EXPECT_TRUE(fs::is_symlink(assets_ + "/sub/out"));
}

TEST_F(AssetDeletionTest, FailuresAndAnAssetsDirectorySwappedForALink) {
  env_.fileSystem->failNext(QRVFakeFileSystemExtras::Operation::kRemoveTree, EIO);
  EXPECT_EQ(remove("file"), 41u);
  auto plain = identity("com.example.plain");
  create(plain);
  EXPECT_EQ(remove("file", plain), 11u);  // no assets directory

  fs::remove_all(assets_);
  fs::create_symlink("Documents", assets_);
  EXPECT_EQ(remove("precious"), 10u);
  EXPECT_TRUE(fs::exists(container_->url() + "/Documents/precious"));
}

TEST_F(ContentsTest, AnAssetsDirectoryThatCannotBeSetUpSaysWhichStepFailedAndLeavesNothing) {
  using Op = QRVFaultInjectionFileSystem::Operation;
  const std::string logPath = env_.root.path() + "/assets.log";
  ASSERT_TRUE(QRVLog::open("test", logPath, QRVLogLevel::kNotice, 2, 1 << 20));
  auto app = identity("com.example.app");
  auto container = create(app);
  ASSERT_NE(container, nullptr);
  for (Op op : {Op::kChangeOwner, Op::kChangeMode}) {
    env_.posixFileSystem->failNext(op, EPERM, "com.kelva.UserManagedAssets.");
    EXPECT_FALSE(assets(app, false, true));
    EXPECT_EQ(error_.code(), 6u);
    // The half-made directory is gone, and nothing names it.
    for (const auto& entry : fs::directory_iterator(container->url()))
      EXPECT_EQ(entry.path().filename().string().rfind("com.kelva.UserManagedAssets.", 0), std::string::npos)
          << entry.path();
  }
  QRVLog::close();
  std::stringstream log;
  log << std::ifstream(logPath).rdbuf();
  for (const char* step :
       {"Failed to chown user managed assets dir at ", "Failed to chmod user managed assets dir at "})
    EXPECT_NE(log.str().find(step), std::string::npos) << step;
  EXPECT_NE(log.str().find(": Operation not permitted"), std::string::npos) << log.str();
  // Without faults the directory is made.
  EXPECT_TRUE(assets(app, false, true)) << error_.description();
}

TEST_F(ContentsTest, DataContainersAreMeasuredEveryTimeBundlesOnce) {
  auto data = identity("com.example.app");
  auto dataContainer = create(data);
  QRVError error;
  auto before = admin()->diskUsageWithContainerIdentity(data, &error);
  ASSERT_TRUE(before.has_value()) << error.description();
  writeFile(dataContainer->url() + "/Documents/big", 1 << 20);
  auto after = admin()->diskUsageWithContainerIdentity(data, &error);
  ASSERT_TRUE(after.has_value());
  EXPECT_GE(*after, *before + (1 << 20));
  EXPECT_FALSE(admin()->infoValueForKey(key("com.kelva.Verdane.StaticDiskUsage"), data, true, &error));

  auto bundle = identity("com.example.app", QRVContainerClassAppBundle);
  auto bundleContainer = create(bundle);
  writeFile(bundleContainer->url() + "/binary", 1 << 20);
  auto first = admin()->diskUsageWithContainerIdentity(bundle, &error);
  ASSERT_TRUE(first.has_value()) << error.description();
  EXPECT_GE(*first, 1u << 20);
  EXPECT_EQ(admin()->infoValueForKey(key("com.kelva.Verdane.StaticDiskUsage"), bundle, true, &error),
            QRVPlist::uinteger(*first));
  writeFile(bundleContainer->url() + "/more", 1 << 20);
  EXPECT_EQ(admin()->diskUsageWithContainerIdentity(bundle, &error), first);

  EXPECT_FALSE(admin()->diskUsageWithContainerIdentity(identity("com.example.none"), &error));
  EXPECT_EQ(error.code(), 21u);

  // Measuring waits at test lock point 2.
  QRVTestLocks& locks = *env_.services->testLocks;
  locks.setEnabled(true);
  ASSERT_TRUE(locks.acquireLock(2));
  std::atomic<bool> done{false};
  std::thread measuring([&] {
    QRVError e;
    EXPECT_TRUE(admin()->diskUsageWithContainerIdentity(data, &e).has_value());
    done = true;
  });
  std::this_thread::sleep_for(std::chrono::milliseconds(200));
  EXPECT_FALSE(done.load());
  locks.releaseLock(2);
  measuring.join();
  locks.setEnabled(false);
}

// An application can nest directories far past the longest path the system
// accepts; its usage must still be measured whole, as `du` counts it.
TEST_F(ContentsTest, DiskUsageOfADeepTreeIsMeasuredWholeAndAFailureIsNoAnswer) {
  auto data = identity("com.example.app");
  auto container = create(data);
  int fd = open(container->url().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  ASSERT_GE(fd, 0);
  for (int level = 0; level < 300; level++) {
    ASSERT_EQ(mkdirat(fd, "twenty-character-dir", 0755), 0);
    int child = openat(fd, "twenty-character-dir", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    close(fd);
    ASSERT_GE(child, 0);
    fd = child;
  }
  int file = openat(fd, "bottom", O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
  close(fd);
  ASSERT_GE(file, 0);
  std::string data1m(1 << 20, 'd');
  ASSERT_EQ(write(file, data1m.data(), data1m.size()), static_cast<ssize_t>(data1m.size()));
  close(file);

  QRVError error;
  auto usage = admin()->diskUsageWithContainerIdentity(data, &error);
  ASSERT_TRUE(usage.has_value()) << error.description();
  EXPECT_GE(*usage, (1u << 20) + 300u * 512u);
  FILE* du = popen(("du -sB1 '" + container->url() + "' 2>/dev/null").c_str(), "r");
  unsigned long long duBytes = 0;
  if (du && fscanf(du, "%llu", &duBytes) == 1 && pclose(du) == 0) {
    EXPECT_EQ(*usage, duBytes);
  }

  // A walk that fails answers a failure, and for a bundle nothing is recorded.
  auto bundle = identity("com.example.app", QRVContainerClassAppBundle);
  create(bundle);
  env_.fileSystem->failNext(QRVFakeFileSystemExtras::Operation::kDirectoryStatistics, EPERM);
  EXPECT_FALSE(admin()->diskUsageWithContainerIdentity(bundle, &error).has_value());
  EXPECT_EQ(error.code(), 10u);  // not EPERM, which would read as success
  EXPECT_FALSE(admin()->infoValueForKey(key("com.kelva.Verdane.StaticDiskUsage"), bundle, true, &error));
  EXPECT_TRUE(admin()->diskUsageWithContainerIdentity(bundle, &error).has_value());
  // The chain is beyond what the test's own clean-up can remove.
  EXPECT_TRUE(env_.services->fileManager->removeItemAtURL(container->url() + "/twenty-character-dir", &error));
}

TEST_F(ContentsTest, NewDirectoryUUIDKeepsTheContainerReachable) {
  auto app = identity("com.example.app");
  auto old = create(app);
  writeFile(old->url() + "/Documents/kept", 10);
  QRVError error;
  auto concreteOld = old->containerIdentity();
  auto moved = admin()->regenerateDirectoryUUIDWithContainerIdentity(concreteOld, &error);
  ASSERT_NE(moved, nullptr) << error.description();
  EXPECT_NE(moved->uuid(), old->uuid());
  EXPECT_EQ(fs::path(moved->url()).filename().string(), moved->uuid().string());
  EXPECT_EQ(fs::path(moved->url()).parent_path(), fs::path(old->url()).parent_path());
  EXPECT_FALSE(fs::exists(old->url()));
  EXPECT_TRUE(fs::exists(moved->url() + "/Documents/kept"));

  for (bool fresh : {false, true}) {
    if (fresh) freshCache();
    auto found = admin()->metadataWithContainerIdentity(app, &error);
    ASSERT_NE(found, nullptr) << error.description();
    EXPECT_EQ(found->uuid(), moved->uuid());
    EXPECT_EQ(found->url(), moved->url());
    // The old UUID names nothing any more.
    EXPECT_EQ(admin()->metadataWithContainerIdentity(concreteOld, &error), nullptr);
    EXPECT_EQ(error.code(), 21u);
  }

  // A directory not named by a UUID (a well-known name) keeps its name.
  env_.services->wellKnownNames = std::make_shared<QRVTestKnowsOneName>();
  freshCache();
  auto wellKnown = identity("com.example.wellknown", QRVContainerClassSystemData);
  auto container = create(wellKnown);
  ASSERT_NE(container, nullptr);
  EXPECT_EQ(admin()->regenerateDirectoryUUIDWithContainerIdentity(wellKnown, &error), nullptr);
  EXPECT_EQ(error.code(), 11u);
  EXPECT_TRUE(fs::exists(container->url()));
}

TEST_F(ContentsTest, SharedContentGoesOnlyToAGrantedGroupAndNeverLeavesEitherContainer) {
  auto own = create(identity("com.example.daemon", QRVContainerClassSystemData));
  auto group = create(identity("systemgroup.com.example.shared", QRVContainerClassSystemGroup));
  const std::string payload = own->url() + "/Library/out/payload";
  fs::create_directories(fs::path(payload).parent_path());
  writeFile(payload, 10);
  // The daemon as a caller that may look up system groups.
  auto daemon = [&] { return QRVContainerTest::connectionFor("com.example.daemon", {.groups = true}); };
  auto stage = [&](const std::string& groupId, const std::string& source, const std::string& dest) -> uint64_t {
    QRVError error;
    return daemon()->stageSharedContentForIdentifier(groupId, source, dest, &error) ? 1 : error.code();
  };
  const std::string shared = "systemgroup.com.example.shared";
  // Without code signing no group is granted.
  EXPECT_EQ(stage(shared, "Library/out/payload", "payload"), 55u);
  EXPECT_EQ(stage(shared, "Library/../../x", "payload"), 38u);
  EXPECT_EQ(stage("", "Library/out/payload", "payload"), 11u);

  env_.services->systemGroups = std::make_shared<GrantsOneGroup>();
  env_.services->codeSigning = std::make_shared<SaysHasSystemContainer>();
  EXPECT_EQ(stage("systemgroup.com.example.other", "Library/out/payload", "payload"), 55u);
  fs::create_symlink("../../..", own->url() + "/Library/up");
  EXPECT_EQ(stage(shared, "Library/up", "payload"), 10u);
  fs::create_symlink("/", group->url() + "/root");
  EXPECT_EQ(stage(shared, "Library/out/payload", "root/payload"), 10u);
  EXPECT_EQ(stage(shared, "Library/out/payload", "../payload"), 38u);
  EXPECT_TRUE(fs::exists(payload));

  // Granted the group, but not allowed to look it up: the look-up's refusal.
  QRVError error;
  EXPECT_FALSE(connectionFor("com.example.daemon")
                   ->stageSharedContentForIdentifier(shared, "Library/out/payload", "payload", &error));
  EXPECT_EQ(error.code(), 55u);
  // A group that is granted but does not exist is not made by staging.
  EXPECT_EQ(stage("systemgroup.com.example.absent", "Library/out/payload", "payload"), 21u);
  EXPECT_EQ(admin()->metadataWithContainerIdentity(
                identity("systemgroup.com.example.absent", QRVContainerClassSystemGroup), &error),
            nullptr);
  EXPECT_TRUE(fs::exists(payload));

  auto dest = daemon()->stageSharedContentForIdentifier(shared, "Library/out/payload", "payload", &error);
  ASSERT_TRUE(dest.has_value()) << error.description();
  EXPECT_EQ(*dest, group->url() + "/payload");
  EXPECT_TRUE(fs::exists(*dest));
  EXPECT_FALSE(fs::exists(payload));
}

}  // namespace

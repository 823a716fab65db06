#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <thread>

#include "model/QRVContainerCache.h"
#include "operations/QRVClientConnection.h"
#include "support/QRVContainerTest.h"

namespace fs = std::filesystem;

namespace {

class SaysHasSystemContainer : public QRVNoCodeSigningQueries {
 public:
  bool identifierHasSystemContainer(const std::string& id) override { return id == "com.example.daemon"; }
};

class AsksForClassThree : public QRVNoDataProtectionQueries {
 public:
  uint32_t intendedDataProtectionClassBasedOnEntitlementsForIdentifier(const std::string&) override { return 3; }
};

class CreateOrLookupTest : public QRVContainerTest {
 protected:
  // Creates (or with `create` false only looks up) as `by`, or as the
  // installer; a failure leaves its error in error_.
  QRVMetadataRef get(const QRVContainerIdentityRef& id, bool create = true, bool transient = false,
                     std::shared_ptr<QRVClientConnection> by = nullptr) {
    error_ = QRVError();
    return (by ? by : admin())->createOrLookupContainerWithContainerIdentity(id, create, transient, true, &error_);
  }
  std::string mobilePath(const std::string& rest) { return env_.root.path() + "/private/var/mobile/Containers/" + rest; }

  QRVError error_;
};

TEST_F(CreateOrLookupTest, CreatesInStagingMovesLiveAndFindsItAgain) {
  auto app = identity("com.example.app", QRVContainerClassAppData);
  EXPECT_EQ(get(app, false), nullptr);
  EXPECT_EQ(error_.code(), 21u);

  auto created = get(app);
  ASSERT_NE(created, nullptr) << error_.description();
  EXPECT_FALSE(created->existed());
  EXPECT_EQ(created->url(), mobilePath("Data/Application/") + created->uuid().string());
  struct stat st;
  ASSERT_EQ(statThroughSeam(created->url(), &st), 0);
  EXPECT_EQ(st.st_uid, 501u);
  for (const char* sub : {"Documents", "Library", "Library/Caches", "Library/Preferences", "SystemData", "tmp"})
    EXPECT_TRUE(fs::is_directory(created->url() + "/" + sub)) << sub;
  // Staging holds nothing once the container is live.
  EXPECT_TRUE(fs::is_empty(mobilePath("Staging")));

  auto again = get(app);
  ASSERT_NE(again, nullptr);
  EXPECT_TRUE(again->existed());
  EXPECT_EQ(again->uuid(), created->uuid());

  // A fresh cache finds it on disk too, but a named UUID must be its own.
  freshCache();
  QRVError error;
  auto reread = admin()->metadataWithContainerIdentity(app, &error);
  ASSERT_NE(reread, nullptr) << error.description();
  EXPECT_EQ(reread->uuid(), created->uuid());
  auto wrongUUID = QRVConcreteContainerIdentity::containerIdentityWithUUID(QRVUUID::random(), app->userIdentity(),
                                                                           app->identifier(), 2, &error);
  EXPECT_EQ(admin()->metadataWithContainerIdentity(wrongUUID, &error), nullptr);
  EXPECT_EQ(error.code(), 21u);

  // Listing is sorted by identifier; an unknown class is refused.
  ASSERT_NE(get(identity("com.example.a", 2)), nullptr);
  auto all = admin()->containersWithClass(QRVContainerClassAppData, false, &error);
  ASSERT_TRUE(all);
  ASSERT_EQ(all->size(), 2u);
  EXPECT_EQ((*all)[0]->identifier(), "com.example.a");
  EXPECT_FALSE(admin()->containersWithClass(14, false, &error));

  fs::remove_all(created->url() + "/Library");
  ASSERT_TRUE(admin()->recreateDefaultStructureWithContainerIdentity(created->containerIdentity(), &error))
      << error.description();
  EXPECT_TRUE(fs::is_directory(created->url() + "/Library/Preferences"));
}

TEST_F(CreateOrLookupTest, TransientRequestsAlwaysGetAFreshContainer) {
  auto app = identity("com.example.app", QRVContainerClassAppData);
  EXPECT_EQ(get(app, false, true), nullptr);
  EXPECT_EQ(error_.code(), 21u);  // never merely looked up
  auto first = get(app, true, true);
  ASSERT_NE(first, nullptr) << error_.description();
  EXPECT_TRUE(first->transient());
  EXPECT_NE(first->url().find("/Containers/Temp/Data/Application/"), std::string::npos);
  std::ofstream(first->url() + "/Documents/old") << "x";
  auto second = get(app, true, true);
  ASSERT_NE(second, nullptr) << error_.description();
  EXPECT_NE(second->uuid(), first->uuid());
  EXPECT_FALSE(fs::exists(first->url()));
  EXPECT_TRUE(fs::is_empty(second->url() + "/Documents"));
  // The live container of the identity is untouched by transient work.
  EXPECT_EQ(get(app, false), nullptr);
}

TEST_F(CreateOrLookupTest, ConcurrentCreatesMakeOneContainer) {
  auto app = identity("com.example.race", QRVContainerClassAppData);
  std::atomic<int> fresh{0}, existed{0};
  std::vector<std::thread> threads;
  std::vector<QRVUUID> uuids(8);
  for (int i = 0; i < 8; i++) {
    threads.emplace_back([&, i] {
      QRVError error;
      auto m = admin()->createOrLookupContainerWithContainerIdentity(app, /*createIfNecessary=*/true,
                                                                     /*transient=*/false, /*useLocking=*/true, &error);
      if (!m) return;
      uuids[i] = m->uuid();
      (m->existed() ? existed : fresh)++;
    });
  }
  for (auto& t : threads) t.join();
  EXPECT_EQ(fresh.load(), 1);
  EXPECT_EQ(existed.load(), 7);
  for (const auto& u : uuids) EXPECT_EQ(u, uuids[0]);
}

TEST_F(CreateOrLookupTest, AccessRules) {
  auto own = identity("com.example.me", QRVContainerClassAppData);
  auto other = identity("com.example.other", QRVContainerClassAppData);
  auto group = identity("group.example", QRVContainerClassAppGroup);
  auto me = connectionFor("com.example.me");
  auto groups = connectionFor("com.example.me", {.groups = true});
  QRVPlist lookup = QRVPlist::dictionary().set("appData", QRVPlist::array({QRVPlist::string("com.example.other")}));
  auto looker = connectionFor("com.example.looker", {.lookup = lookup});

  struct Case {
    std::shared_ptr<QRVClientConnection> by;
    QRVContainerIdentityRef id;
    uint64_t code;  // 1: allowed
  };
  const Case cases[] = {
      {me, own, 1}, {me, other, 55}, {me, nullptr, 38},
      // Its own system container only when code signing grants it one.
      {me, identity("com.example.me", QRVContainerClassSystemData), 55},
      // Group look-up reaches group containers of anyone, and nothing else.
      {groups, group, 1}, {groups, identity("systemgroup.example", QRVContainerClassSystemGroup), 1},
      {groups, other, 55},
      // The lookup entitlement grants identifiers per class.
      {looker, other, 1}, {looker, group, 55}};
  for (size_t i = 0; i < std::size(cases); i++) {
    SCOPED_TRACE(i);
    auto m = get(cases[i].id, true, false, cases[i].by);
    EXPECT_EQ(m ? 1u : error_.code(), cases[i].code) << error_.description();
  }
  env_.services->codeSigning = std::make_shared<SaysHasSystemContainer>();
  EXPECT_NE(get(identity("com.example.daemon", QRVContainerClassSystemData), true, false,
                connectionFor("com.example.daemon")),
            nullptr)
      << error_.description();
}

TEST_F(CreateOrLookupTest, SystemContainersAndWellKnownNames) {
  env_.services->wellKnownNames = std::make_shared<QRVTestKnowsOneName>();
  freshCache();
  auto wellKnown = identity("com.example.wellknown", QRVContainerClassSystemData);
  auto known = get(wellKnown);
  ASSERT_NE(known, nullptr) << error_.description();
  EXPECT_EQ(known->url(), env_.root.path() + "/private/var/containers/Data/System/com.example.wellknown");
  auto plain = get(identity("com.example.sys", QRVContainerClassSystemData));
  ASSERT_NE(plain, nullptr);
  EXPECT_EQ(fs::path(plain->url()).filename(), plain->uuid().string());
  // Entries of a system container belong to nobody and are reached through
  // the group ACL; the container itself stays root's.
  struct stat st;
  ASSERT_EQ(statThroughSeam(plain->url() + "/Library", &st), 0);
  EXPECT_EQ(st.st_uid, QRVFileManager::kSystemContainerOwner);
  ASSERT_EQ(statThroughSeam(plain->url(), &st), 0);
  EXPECT_EQ(st.st_uid, geteuid());
  // Found again after a restart of the cache.
  freshCache();
  auto found = get(wellKnown, false);
  ASSERT_NE(found, nullptr) << error_.description();
  EXPECT_EQ(found->uuid(), known->uuid());
}

TEST_F(CreateOrLookupTest, FailuresLeaveNothingLive) {
  // The class directory cannot exist: a file stands in its way.
  const std::string parent = mobilePath("Data/Application"), staging = mobilePath("Staging");
  fs::create_directories(fs::path(parent).parent_path());
  std::ofstream(parent) << "in the way";
  auto app = identity("com.example.app", QRVContainerClassAppData);
  EXPECT_EQ(get(app), nullptr);
  EXPECT_EQ(error_.code(), 43u);  // the cache cannot read the class directory
  fs::remove(parent);

  // No staging directory can be made.
  fs::remove_all(staging);
  std::ofstream(staging) << "in the way";
  EXPECT_EQ(get(app), nullptr);
  EXPECT_EQ(error_.code(), 7u);
  fs::remove(staging);
  EXPECT_TRUE(fs::is_empty(parent));

  // A default subdirectory cannot be given its class: the container never
  // goes live.
  env_.services->dataProtection = std::make_shared<AsksForClassThree>();
  env_.fileSystem->failNext(QRVFakeFileSystemExtras::Operation::kSetProtectionClass, EIO, 100);
  EXPECT_EQ(get(app), nullptr);
  EXPECT_EQ(error_.code(), 6u);
  EXPECT_TRUE(fs::is_empty(parent));
  env_.fileSystem->failNext(QRVFakeFileSystemExtras::Operation::kSetProtectionClass, 0, 0);
  auto made = get(app);
  ASSERT_NE(made, nullptr) << error_.description();
  uint32_t cls = 0;
  QRVError error;
  ASSERT_TRUE(env_.services->fileManager->dataProtectionClassOfItemAtURL(made->url() + "/Documents", &cls, &error));
  EXPECT_EQ(cls, 3u);
  // SystemData never counts as user data: it gets no class.
  ASSERT_TRUE(env_.services->fileManager->dataProtectionClassOfItemAtURL(made->url() + "/SystemData", &cls, &error));
  EXPECT_EQ(cls, 0u);
}

// After a power loss a live container must have its default
// subdirectories: every directory that received one is flushed after the
// last of them is made and before the rename that puts the container live.
TEST_F(CreateOrLookupTest, ANewContainersStructureIsOnDiskBeforeItGoesLive) {
  using Op = QRVFaultInjectionFileSystem::Operation;
  env_.posixFileSystem->startTracing();
  auto made = get(identity("com.example.durable", QRVContainerClassAppData));
  ASSERT_NE(made, nullptr) << error_.description();
  const auto trace = env_.posixFileSystem->trace();
  auto live = std::find_if(trace.begin(), trace.end(),
                           [&](const auto& call) { return call.op == Op::kRename && call.otherPath == made->url(); });
  ASSERT_NE(live, trace.end());
  const std::string staging = live->path;
  // The structure is made relative to the container's descriptor, one
  // component at a time; the configuration's own directories by full path.
  auto lastMade = std::find_if(std::make_reverse_iterator(live), trace.rend(), [](const auto& call) {
    return call.op == Op::kMakeDirectory && !call.path.empty() && call.path[0] != '/';
  });
  ASSERT_NE(lastMade, trace.rend());
  for (const std::string& directory : {staging, staging + "/Library"}) {
    EXPECT_TRUE(std::any_of(lastMade.base(), live, [&](const auto& call) {
      return call.op == Op::kSynchronize && call.path == directory;
    })) << directory << " is not flushed between its last new entry and the move live";
  }
  // A flush of the structure that fails fails the creation: nothing goes
  // live. The failure is aimed at the same flush of the next creation.
  auto isStagingFlush = [](const auto& call) {
    return call.op == Op::kSynchronize && call.path.find("/Staging/") != std::string::npos;
  };
  auto libraryFlush = std::find_if(lastMade.base(), live, [&](const auto& call) {
    return call.op == Op::kSynchronize && call.path == staging + "/Library";
  });
  ASSERT_NE(libraryFlush, live);
  const int nth = static_cast<int>(std::count_if(trace.begin(), libraryFlush + 1, isStagingFlush));
  env_.posixFileSystem->inject(Op::kSynchronize, {EIO, nth, 1, "/Staging/"});
  EXPECT_EQ(get(identity("com.example.unflushed", QRVContainerClassAppData)), nullptr);
  EXPECT_EQ(error_.code(), 6u) << error_.description();
  EXPECT_TRUE(!fs::exists(mobilePath("Staging")) || fs::is_empty(mobilePath("Staging")));
  EXPECT_EQ(fs::path(made->url()).parent_path(), fs::path(mobilePath("Data/Application")));
  EXPECT_EQ(std::distance(fs::directory_iterator(mobilePath("Data/Application")), fs::directory_iterator()), 1);
}

}  // namespace

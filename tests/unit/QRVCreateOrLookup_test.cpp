#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <thread>

#include "QRVClientConnection.h"
#include "QRVContainerCache.h"
#include "support/QRVTestServices.h"

namespace fs = std::filesystem;

namespace {

class SaysHasSystemContainer : public QRVNoCodeSigningQueries {
 public:
  bool identifierHasSystemContainer(const std::string& id) override { return id == "com.example.daemon"; }
};

class KnowsOneName : public QRVNoWellKnownNames {
 public:
  std::optional<std::string> wellknownSystemContainerForId(const std::string& id) override {
    return id == "com.example.wellknown" ? std::optional<std::string>("com.example.wellknown") : std::nullopt;
  }
  bool systemContainerIdIsWellknown(const std::string& id) override { return id == "com.example.wellknown"; }
};

class AsksForClassThree : public QRVNoDataProtectionQueries {
 public:
  uint32_t intendedDataProtectionClassBasedOnEntitlementsForIdentifier(const std::string&) override { return 3; }
};

struct Powers {
  bool allowOtherIdLookup = false, unrestricted = false, groups = false;
  std::optional<QRVPlist> lookup;
};

class CreateOrLookupTest : public testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root: containers are given to their owners";
  }

  std::shared_ptr<QRVClientConnection> connectionFor(const std::string& caller, Powers p = {}) {
    auto user = env_.services->userIdentityCache->userIdentityForPersonalPersonaWithUID(501, 501);
    auto identity = std::make_shared<const QRVClientIdentity>(caller, 501, 501, 42, user, QRVPlist::dictionary(), false,
                                                              QRVAuditToken::make(501, 501, 42, 1));
    auto c = std::make_shared<QRVClientConnection>(identity, true, p.allowOtherIdLookup, p.unrestricted, p.lookup,
                                                   std::nullopt, std::make_shared<QRVCommandQueue>(), env_.services);
    c->setAllowGroupIdLookup(p.groups);
    return c;
  }
  std::shared_ptr<QRVClientConnection> admin() { return connectionFor("com.example.installer", {true, true}); }

  QRVContainerIdentityRef identity(const std::string& id, QRVContainerClass c) {
    QRVError error;
    auto user = QRVUserIdentity::isUserIdentityRequiredForContainerClass(c)
                    ? env_.services->userIdentityCache->userIdentityForPersonalPersonaWithUID(501, 501)
                    : env_.services->userIdentityCache->defaultUserIdentity();
    return QRVContainerIdentity::containerIdentityWithUserIdentity(user, id, c, &error);
  }

  QRVTestServices env_;
};

TEST_F(CreateOrLookupTest, CreatesInStagingMovesLiveAndFindsItAgain) {
  QRVError error;
  auto app = identity("com.example.app", QRVContainerClassAppData);
  auto missing = admin()->createOrLookupContainerWithContainerIdentity(app, false, false, true, &error);
  EXPECT_EQ(missing, nullptr);
  EXPECT_EQ(error.code(), 21u);

  auto created = admin()->createOrLookupContainerWithContainerIdentity(app, true, false, true, &error);
  ASSERT_NE(created, nullptr) << error.description();
  EXPECT_FALSE(created->existed());
  const std::string parent = env_.root.path() + "/private/var/mobile/Containers/Data/Application";
  EXPECT_EQ(created->url(), parent + "/" + created->uuid().string());
  struct stat st;
  ASSERT_EQ(stat(created->url().c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, 501u);
  EXPECT_TRUE(fs::exists(created->url() + "/.com.kelva.quorva.metadata.plist"));
  for (const char* sub : {"Documents", "Library", "Library/Caches", "Library/Preferences", "SystemData", "tmp"})
    EXPECT_TRUE(fs::is_directory(created->url() + "/" + sub)) << sub;
  // Staging holds nothing once the container is live.
  std::string staging = env_.root.path() + "/private/var/mobile/Containers/Staging";
  EXPECT_TRUE(fs::is_empty(staging));

  auto again = admin()->createOrLookupContainerWithContainerIdentity(app, true, false, true, &error);
  ASSERT_NE(again, nullptr);
  EXPECT_TRUE(again->existed());
  EXPECT_EQ(again->uuid(), created->uuid());

  // A fresh cache finds it on disk too.
  env_.services->containerCache = std::make_shared<QRVContainerCache>(
      env_.services->fileManager, env_.services->globalConfiguration, env_.services->userIdentityCache,
      env_.services->platform.sandbox);
  auto reread = admin()->metadataWithContainerIdentity(app, &error);
  ASSERT_NE(reread, nullptr) << error.description();
  EXPECT_EQ(reread->uuid(), created->uuid());

  // A named UUID must be the container's own.
  auto wrongUUID = QRVConcreteContainerIdentity::containerIdentityWithUUID(QRVUUID::random(), app->userIdentity(),
                                                                           app->identifier(), 2, &error);
  EXPECT_EQ(admin()->metadataWithContainerIdentity(wrongUUID, &error), nullptr);
  EXPECT_EQ(error.code(), 21u);
}

TEST_F(CreateOrLookupTest, TransientRequestsAlwaysGetAFreshContainer) {
  QRVError error;
  auto tmp = identity("com.example.app", QRVContainerClassAppData);
  EXPECT_EQ(admin()->createOrLookupContainerWithContainerIdentity(tmp, false, true, true, &error), nullptr);
  EXPECT_EQ(error.code(), 21u);  // never merely looked up
  auto first = admin()->createOrLookupContainerWithContainerIdentity(tmp, true, true, true, &error);
  ASSERT_NE(first, nullptr) << error.description();
  EXPECT_TRUE(first->transient());
  EXPECT_NE(first->url().find("/Containers/Temp/Data/Application/"), std::string::npos);
  std::ofstream(first->url() + "/Documents/old") << "x";
  auto second = admin()->createOrLookupContainerWithContainerIdentity(tmp, true, true, true, &error);
  ASSERT_NE(second, nullptr) << error.description();
  EXPECT_NE(second->uuid(), first->uuid());
  EXPECT_FALSE(fs::exists(first->url()));
  EXPECT_TRUE(fs::is_empty(second->url() + "/Documents"));
  // The live container of the identity is untouched by transient work.
  EXPECT_EQ(admin()->createOrLookupContainerWithContainerIdentity(tmp, false, false, true, &error), nullptr);
}

TEST_F(CreateOrLookupTest, ConcurrentCreatesMakeOneContainer) {
  auto app = identity("com.example.race", QRVContainerClassAppData);
  std::atomic<int> fresh{0}, existed{0};
  std::vector<std::thread> threads;
  std::vector<QRVUUID> uuids(8);
  for (int i = 0; i < 8; i++) {
    threads.emplace_back([&, i] {
      QRVError error;
      auto m = admin()->createOrLookupContainerWithContainerIdentity(app, true, false, true, &error);
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
  QRVError error;
  auto own = identity("com.example.me", QRVContainerClassAppData);
  auto other = identity("com.example.other", QRVContainerClassAppData);
  auto group = identity("group.example", QRVContainerClassAppGroup);
  auto systemGroup = identity("systemgroup.example", QRVContainerClassSystemGroup);
  auto ownSystem = identity("com.example.me", QRVContainerClassSystemData);
  auto daemonSystem = identity("com.example.daemon", QRVContainerClassSystemData);

  auto me = connectionFor("com.example.me");
  EXPECT_NE(me->createOrLookupContainerWithContainerIdentity(own, true, false, true, &error), nullptr);
  EXPECT_EQ(me->createOrLookupContainerWithContainerIdentity(other, true, false, true, &error), nullptr);
  EXPECT_EQ(error.code(), 55u);
  // Its own system container only when code signing grants it one.
  EXPECT_EQ(me->createOrLookupContainerWithContainerIdentity(ownSystem, true, false, true, &error), nullptr);
  EXPECT_EQ(error.code(), 55u);
  env_.services->codeSigning = std::make_shared<SaysHasSystemContainer>();
  auto daemon = connectionFor("com.example.daemon");
  EXPECT_NE(daemon->createOrLookupContainerWithContainerIdentity(daemonSystem, true, false, true, &error), nullptr)
      << error.description();

  // Group look-up reaches group containers of anyone, and nothing else.
  auto groups = connectionFor("com.example.me", {false, false, true});
  EXPECT_NE(groups->createOrLookupContainerWithContainerIdentity(group, true, false, true, &error), nullptr);
  EXPECT_NE(groups->createOrLookupContainerWithContainerIdentity(systemGroup, true, false, true, &error), nullptr);
  EXPECT_EQ(groups->createOrLookupContainerWithContainerIdentity(other, true, false, true, &error), nullptr);
  EXPECT_EQ(error.code(), 55u);

  // The lookup entitlement grants identifiers per class.
  QRVPlist lookup = QRVPlist::dictionary().set("appData", QRVPlist::array({QRVPlist::string("com.example.other")}));
  auto looker = connectionFor("com.example.looker", {false, false, false, lookup});
  EXPECT_TRUE(looker->isEntitledForLookupWithClass(2, "com.example.other"));
  EXPECT_FALSE(looker->isEntitledForLookupWithClass(4, "com.example.other"));
  EXPECT_NE(looker->createOrLookupContainerWithContainerIdentity(other, true, false, true, &error), nullptr);
  EXPECT_EQ(looker->createOrLookupContainerWithContainerIdentity(group, true, false, true, &error), nullptr);
  EXPECT_EQ(error.code(), 55u);

  EXPECT_EQ(me->createOrLookupContainerWithContainerIdentity(nullptr, true, false, true, &error), nullptr);
  EXPECT_EQ(error.code(), 38u);
}

TEST_F(CreateOrLookupTest, SystemContainersAndWellKnownNames) {
  QRVError error;
  env_.services->wellKnownNames = std::make_shared<KnowsOneName>();
  env_.services->containerCache = std::make_shared<QRVContainerCache>(
      env_.services->fileManager, env_.services->globalConfiguration, env_.services->userIdentityCache,
      env_.services->platform.sandbox, nullptr, env_.services->wellKnownNames);
  auto known = admin()->createOrLookupContainerWithContainerIdentity(
      identity("com.example.wellknown", QRVContainerClassSystemData), true, false, true, &error);
  ASSERT_NE(known, nullptr) << error.description();
  EXPECT_EQ(known->url(), env_.root.path() + "/private/var/containers/Data/System/com.example.wellknown");
  auto plain = admin()->createOrLookupContainerWithContainerIdentity(
      identity("com.example.sys", QRVContainerClassSystemData), true, false, true, &error);
  ASSERT_NE(plain, nullptr);
  EXPECT_EQ(fs::path(plain->url()).filename(), plain->uuid().string());
  // Entries of a system container belong to nobody and are reached through
  // the group ACL; the container itself stays root's.
  struct stat st;
  ASSERT_EQ(stat((plain->url() + "/Library").c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, QRVFileManager::kSystemContainerOwner);
  ASSERT_EQ(stat(plain->url().c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, 0u);
  // Found again after a restart of the cache, by either name.
  env_.services->containerCache = std::make_shared<QRVContainerCache>(
      env_.services->fileManager, env_.services->globalConfiguration, env_.services->userIdentityCache,
      env_.services->platform.sandbox, nullptr, env_.services->wellKnownNames);
  auto found = admin()->createOrLookupContainerWithContainerIdentity(
      identity("com.example.wellknown", QRVContainerClassSystemData), false, false, true, &error);
  ASSERT_NE(found, nullptr) << error.description();
  EXPECT_EQ(found->uuid(), known->uuid());
}

TEST_F(CreateOrLookupTest, FailuresLeaveNothingLive) {
  QRVError error;
  // The class directory cannot exist: a file stands in its way.
  std::string parent = env_.root.path() + "/private/var/mobile/Containers/Data/Application";
  fs::create_directories(fs::path(parent).parent_path());
  std::ofstream(parent) << "in the way";
  auto app = identity("com.example.app", QRVContainerClassAppData);
  EXPECT_EQ(admin()->createOrLookupContainerWithContainerIdentity(app, true, false, true, &error), nullptr);
  EXPECT_EQ(error.code(), 43u);  // the cache cannot read the class directory
  fs::remove(parent);

  // No staging directory can be made.
  std::string staging = env_.root.path() + "/private/var/mobile/Containers/Staging";
  fs::remove_all(staging);
  std::ofstream(staging) << "in the way";
  EXPECT_EQ(admin()->createOrLookupContainerWithContainerIdentity(app, true, false, true, &error), nullptr);
  EXPECT_EQ(error.code(), 7u);
  fs::remove(staging);
  EXPECT_TRUE(fs::is_empty(parent));

  // A default subdirectory cannot be given its class: the container never
  // goes live.
  env_.services->dataProtection = std::make_shared<AsksForClassThree>();
  env_.fileSystem->failNext(QRVFakeFileSystemExtras::Operation::kSetProtectionClass, EIO, 100);
  EXPECT_EQ(admin()->createOrLookupContainerWithContainerIdentity(app, true, false, true, &error), nullptr);
  EXPECT_EQ(error.code(), 6u);
  EXPECT_TRUE(fs::is_empty(parent));
  env_.fileSystem->failNext(QRVFakeFileSystemExtras::Operation::kSetProtectionClass, 0, 0);
  auto made = admin()->createOrLookupContainerWithContainerIdentity(app, true, false, true, &error);
  ASSERT_NE(made, nullptr) << error.description();
  uint32_t cls = 0;
  ASSERT_TRUE(env_.services->fileManager->dataProtectionClassOfItemAtURL(made->url() + "/Documents", &cls, &error));
  EXPECT_EQ(cls, 3u);
  // SystemData never counts as user data: it gets no class.
  ASSERT_TRUE(env_.services->fileManager->dataProtectionClassOfItemAtURL(made->url() + "/SystemData", &cls, &error));
  EXPECT_EQ(cls, 0u);
}

TEST_F(CreateOrLookupTest, ListingAndRecreatingTheDefaultStructure) {
  QRVError error;
  for (const char* id : {"com.example.b", "com.example.a"})
    ASSERT_NE(admin()->createOrLookupContainerWithContainerIdentity(identity(id, 2), true, false, true, &error), nullptr);
  auto all = admin()->containersWithClass(QRVContainerClassAppData, false, &error);
  ASSERT_TRUE(all);
  ASSERT_EQ(all->size(), 2u);
  EXPECT_EQ((*all)[0]->identifier(), "com.example.a");
  EXPECT_FALSE(admin()->containersWithClass(14, false, &error));

  auto a = admin()->metadataWithContainerIdentity(identity("com.example.a", 2), &error);
  fs::remove_all(a->url() + "/Library");
  ASSERT_TRUE(admin()->recreateDefaultStructureWithContainerIdentity(a->containerIdentity(), &error))
      << error.description();
  EXPECT_TRUE(fs::is_directory(a->url() + "/Library/Preferences"));
}

}  // namespace

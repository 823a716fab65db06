#include "QRVContainerCache.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <map>
#include <set>
#include <stdexcept>
#include <thread>

#include "support/QRVTestServices.h"

namespace {

namespace fs = std::filesystem;

class FakeParents : public QRVPluginParentResolver {
 public:
  std::map<std::string, std::string> parents;
  std::optional<std::string> parentIdentifierForChildIdentifier(const std::string& child) override {
    auto it = parents.find(child);
    return it == parents.end() ? std::nullopt : std::optional<std::string>(it->second);
  }
};

class FakeWellKnown : public QRVWellKnownNames {
 public:
  std::set<std::string> system, group;
  bool throws = false;
  bool systemContainerIdIsWellknown(const std::string& name) override {
    if (throws) throw std::runtime_error("well-known table unavailable");
    return system.count(name) > 0;
  }
  bool systemGroupContainerIdIsWellknown(const std::string& name) override { return group.count(name) > 0; }
};

class ContainerCacheTest : public testing::Test {
 protected:
  ContainerCacheTest() {
    alice_ = identities().userIdentityForPersonalPersonaWithUID(501, 501);
    bob_ = QRVUserIdentity::make(502, 502, env_.root.path() + "/home/bob", "", QRVPersonaTypePersonal, 1002);
    system_ = identities().defaultUserIdentity();
  }

  QRVFileManager& fm() { return *env_.services->fileManager; }
  QRVGlobalConfiguration& config() { return *env_.services->globalConfiguration; }
  QRVUserIdentityCache& identities() { return *env_.services->userIdentityCache; }
  QRVFakeSandbox& sandbox() { return *env_.sandbox; }

  std::shared_ptr<QRVContainerCache> makeCache() {
    return std::make_shared<QRVContainerCache>(env_.services->fileManager, env_.services->globalConfiguration,
                                               env_.services->userIdentityCache, env_.sandbox, parents_, wellKnown_);
  }

  std::string classDirectory(const QRVUserIdentityRef& u, QRVContainerClass c, bool transient = false) {
    return *config().containerDirectoryURLForUserIdentity(u, c, transient);
  }

  // A real container on disk: its directory (named by its UUID unless
  // `name` is given) and its metadata file.
  QRVMetadataRef makeContainer(const QRVUserIdentityRef& u, QRVContainerClass c, const std::string& identifier,
                               bool transient = false, std::optional<QRVUUID> uuid = std::nullopt,
                               const std::string& name = "") {
    QRVUUID id = uuid ? *uuid : QRVUUID::random();
    std::string dir = classDirectory(u, c, transient) + "/" + (name.empty() ? id.string() : name);
    fs::create_directories(dir);
    auto identity = QRVConcreteContainerIdentity::containerIdentityWithUUID(id, u, identifier, c, nullptr);
    auto m = QRVMetadata::make(*identity, QRVPlist(), dir, "");
    QRVError error;
    EXPECT_TRUE(m->writeMetadataToDisk(fm(), config(), &error)) << error.description();
    return m;
  }

  QRVContainerIdentityRef id(const QRVUserIdentityRef& u, const std::string& identifier, QRVContainerClass c) {
    return QRVContainerIdentity::containerIdentityWithUserIdentity(u, identifier, c, nullptr);
  }

  QRVMetadataRef lookup(QRVContainerCache& cache, const QRVUserIdentityRef& u, const std::string& identifier,
                        QRVContainerClass c, QRVError* error, bool transient = false, bool updateSandbox = false) {
    return cache.containerForContainerIdentity(*id(u, identifier, c), transient, updateSandbox, error);
  }

  // A personal persona, two enterprise personas ("WORK" has the mail
  // application, "OTHER" nothing) and, for applications installed in more
  // than one persona, a second record of the personal user.
  void usePersonas() {
    env_.personas->supported = true;
    env_.personas->list = {
        {1000, 501, 501, QRVPersonaTypePersonal, "PERSONAL", "/private/var/mobile", {}, false, false},
        {1001, 501, 501, QRVPersonaTypeEnterprise, "WORK", "/private/var/work", {"com.example.mail", "com.example.shared"},
         true, false},
        {1002, 501, 501, QRVPersonaTypeEnterprise, "OTHER", "/private/var/other", {}, false, false},
        {1003, 501, 501, QRVPersonaTypePersonal, "PERSONAL2", "/private/var/mobile", {"com.example.shared"}, true,
         false},
    };
    identities().flush();
    personal_ = identities().userIdentityForPersonalPersona();
    work_ = identities().userIdentityWithPersonaID(1001);
    other_ = identities().userIdentityWithPersonaID(1002);
    ASSERT_TRUE(personal_ && work_ && other_);
    ASSERT_TRUE(work_->isEnterprise());
  }

  QRVTestServices env_;
  std::shared_ptr<FakeParents> parents_ = std::make_shared<FakeParents>();
  std::shared_ptr<FakeWellKnown> wellKnown_ = std::make_shared<FakeWellKnown>();
  QRVUserIdentityRef alice_, bob_, system_, personal_, work_, other_;
};

// ---- Building from disk ----

TEST_F(ContainerCacheTest, BuildsLazilyFromDiskAndKeepsWhatItBuilt) {
  auto a = makeContainer(alice_, QRVContainerClassAppData, "com.example.a");
  auto c = makeContainer(alice_, QRVContainerClassAppData, "com.example.c");
  auto b = makeContainer(alice_, QRVContainerClassAppData, "com.example.b");
  // The daemon's own instance is wired to its services.
  QRVContainerCache& cache = *env_.services->containerCache;
  QRVError error;
  auto found = cache.containerForContainerIdentity(*id(alice_, "com.example.a", QRVContainerClassAppData), &error);
  ASSERT_NE(found, nullptr) << error.description();
  EXPECT_EQ(found->url(), a->url());
  EXPECT_EQ(found->uuid(), a->uuid());
  EXPECT_FALSE(found->transient());

  auto all = cache.allContainersForUserIdentity(alice_, QRVContainerClassAppData, false, &error);
  ASSERT_TRUE(all);
  ASSERT_EQ(all->size(), 3u);
  EXPECT_EQ((*all)[0]->identifier(), "com.example.a");
  EXPECT_EQ((*all)[1]->url(), b->url());
  EXPECT_EQ((*all)[2]->url(), c->url());

  // Built once: a container made behind the cache's back is not seen until
  // the map is built again.
  makeContainer(alice_, QRVContainerClassAppData, "com.example.d");
  EXPECT_EQ(lookup(cache, alice_, "com.example.d", QRVContainerClassAppData, &error), nullptr);
  EXPECT_EQ(error.code(), 21u);
  EXPECT_EQ(error.message(), "Cache: [501]-Data/Application: Container Not Found with ID: com.example.d");
  EXPECT_NE(lookup(*makeCache(), alice_, "com.example.d", QRVContainerClassAppData, &error), nullptr);

  // Maps are per user identity.
  EXPECT_EQ(lookup(cache, bob_, "com.example.a", QRVContainerClassAppData, &error), nullptr);
  EXPECT_EQ(error.code(), 21u);
  auto none = cache.allContainersForUserIdentity(bob_, QRVContainerClassAppData, false, &error);
  ASSERT_TRUE(none);
  EXPECT_TRUE(none->empty());
}

TEST_F(ContainerCacheTest, AVanishedMetadataFileIs44ThenNotFound) {
  auto a = makeContainer(alice_, QRVContainerClassAppData, "com.example.a");
  auto cache = makeCache();
  QRVError error;
  ASSERT_NE(lookup(*cache, alice_, "com.example.a", QRVContainerClassAppData, &error), nullptr);
  ASSERT_TRUE(fs::remove(a->metadataFileURL()));

  EXPECT_EQ(lookup(*cache, alice_, "com.example.a", QRVContainerClassAppData, &error), nullptr);
  EXPECT_EQ(error.code(), 44u);
  EXPECT_EQ(error.message(), "Cache: [501]-Data/Application: INCONSISTENT-No Metadata at: " + a->metadataFileURL() +
                                 " for id: com.example.a, class: 2");
  EXPECT_EQ(lookup(*cache, alice_, "com.example.a", QRVContainerClassAppData, &error), nullptr);
  EXPECT_EQ(error.code(), 21u);

  // Once the container is whole again and recorded, it is found.
  ASSERT_TRUE(a->writeMetadataToDisk(fm(), config(), &error));
  ASSERT_TRUE(cache->addContainerMetadata(a, a->url(), false, false, &error));
  EXPECT_NE(lookup(*cache, alice_, "com.example.a", QRVContainerClassAppData, &error), nullptr);
}

TEST_F(ContainerCacheTest, OfTwoDirectoriesClaimingOneIdentifierTheLastListedWins) {
  auto first = makeContainer(alice_, QRVContainerClassAppData, "com.example.twice", false,
                             QRVUUID::fromString("00000000-0000-4000-8000-000000000001"));
  auto last = makeContainer(alice_, QRVContainerClassAppData, "com.example.twice", false,
                            QRVUUID::fromString("FFFFFFFF-FFFF-4FFF-8FFF-FFFFFFFFFFFF"));
  QRVError error;
  auto found = lookup(*makeCache(), alice_, "com.example.twice", QRVContainerClassAppData, &error);
  ASSERT_NE(found, nullptr);
  EXPECT_EQ(found->url(), last->url());
  EXPECT_NE(found->url(), first->url());
}

TEST_F(ContainerCacheTest, TransientAndLiveContainersAreIndexedApart) {
  auto live = makeContainer(alice_, QRVContainerClassAppData, "com.example.a");
  auto temporary = makeContainer(alice_, QRVContainerClassAppData, "com.example.a", true);
  auto systemTemporary = makeContainer(system_, QRVContainerClassSystemData, "com.example.daemon", true);
  auto cache = makeCache();
  QRVError error;
  auto l = lookup(*cache, alice_, "com.example.a", QRVContainerClassAppData, &error, false);
  auto t = lookup(*cache, alice_, "com.example.a", QRVContainerClassAppData, &error, true);
  ASSERT_TRUE(l && t);
  EXPECT_EQ(l->url(), live->url());
  EXPECT_FALSE(l->transient());
  EXPECT_EQ(t->url(), temporary->url());
  EXPECT_TRUE(t->transient());
  EXPECT_NE(t->url().find("/Containers/Temp/Data/Application/"), std::string::npos);

  auto s = lookup(*cache, alice_, "com.example.daemon", QRVContainerClassSystemData, &error, true);
  ASSERT_NE(s, nullptr) << error.description();
  EXPECT_EQ(s->url(), systemTemporary->url());
  EXPECT_EQ(lookup(*cache, alice_, "com.example.daemon", QRVContainerClassSystemData, &error, false), nullptr);
  EXPECT_EQ(error.code(), 21u);
  EXPECT_EQ(error.message(), "Cache: Data/System: Container Not Found with ID: com.example.daemon");

  ASSERT_TRUE(cache->removeContainerForUserIdentity(alice_, QRVContainerClassAppData, "com.example.a", true, &error));
  EXPECT_EQ(lookup(*cache, alice_, "com.example.a", QRVContainerClassAppData, &error, true), nullptr);
  EXPECT_EQ(error.message(), "Cache: [501]-Data/Application(transient): Container Not Found with ID: com.example.a");
  EXPECT_NE(lookup(*cache, alice_, "com.example.a", QRVContainerClassAppData, &error, false), nullptr);
}

TEST_F(ContainerCacheTest, OnlyValidEntriesBecomeContainers) {
  const std::string dir = classDirectory(alice_, QRVContainerClassAppData);
  auto good = makeContainer(alice_, QRVContainerClassAppData, "com.example.good");
  makeContainer(alice_, QRVContainerClassAppData, "com.example.named", false, std::nullopt, "Junk");
  makeContainer(alice_, QRVContainerClassAppData, "com.example.odd", false, std::nullopt, "odd name\nwith newline");
  makeContainer(alice_, QRVContainerClassAppData, "com.example.lower", false, std::nullopt,
                "not-a-uuid-but-36-characters-long!!!");
  // A regular file, an empty directory and a directory with garbage where
  // the metadata belongs, all with UUID names.
  std::ofstream(dir + "/" + QRVUUID::random().string()) << "file";
  fs::create_directory(dir + "/" + QRVUUID::random().string());
  std::string garbage = dir + "/" + QRVUUID::random().string();
  fs::create_directory(garbage);
  std::ofstream(garbage + "/" + QRVMetadata::kFileName) << "bplist00 garbage";
  // Another user's container, and a plug-in container, in alice's tree.
  auto bobs = makeContainer(bob_, QRVContainerClassAppData, "com.example.bob");
  fs::rename(bobs->url(), dir + "/" + bobs->uuid().string());
  auto plugin = makeContainer(alice_, QRVContainerClassPluginData, "com.example.plugin");
  fs::rename(plugin->url(), dir + "/" + plugin->uuid().string());
  // A link named like a container, to a good container outside the tree.
  const std::string outside = env_.root.path() + "/outside/Data/Application";
  fs::create_directories(outside);
  auto elsewhere = makeContainer(alice_, QRVContainerClassAppData, "com.example.linked");
  fs::rename(elsewhere->url(), outside + "/" + elsewhere->uuid().string());
  fs::create_directory_symlink(outside + "/" + elsewhere->uuid().string(), dir + "/" + QRVUUID::random().string());

  auto cache = makeCache();
  QRVError error;
  auto all = cache->allContainersForUserIdentity(alice_, QRVContainerClassAppData, false, &error);
  ASSERT_TRUE(all) << error.description();
  ASSERT_EQ(all->size(), 1u);
  EXPECT_EQ((*all)[0]->url(), good->url());
  for (const char* skipped : {"com.example.named", "com.example.odd", "com.example.lower", "com.example.bob",
                              "com.example.plugin", "com.example.linked"}) {
    EXPECT_EQ(lookup(*cache, alice_, skipped, QRVContainerClassAppData, &error), nullptr) << skipped;
    EXPECT_EQ(error.code(), 21u) << skipped;
  }
  // Nothing outside the tree was changed.
  EXPECT_TRUE(fs::exists(outside + "/" + elsewhere->uuid().string() + "/" + QRVMetadata::kFileName));

  // Lower-case UUIDs are UUIDs.
  std::string lower = QRVUUID::random().string();
  for (char& ch : lower) ch = static_cast<char>(tolower(ch));
  EXPECT_TRUE(cache->containerURL(dir + "/" + lower, QRVContainerClassAppData));
  EXPECT_TRUE(cache->containerURL(dir + "/" + lower + "/", QRVContainerClassAppData));
  EXPECT_FALSE(cache->containerURL(dir + "/Junk", QRVContainerClassAppData));
  EXPECT_FALSE(cache->containerURL("", QRVContainerClassAppData));
}

TEST_F(ContainerCacheTest, WellKnownNamesCountForSystemClassesOnly) {
  const std::string name = "com.example.wellknown";
  const std::string groupName = "systemgroup.com.example.shared";
  makeContainer(system_, QRVContainerClassSystemData, name, false, std::nullopt, name);
  makeContainer(system_, QRVContainerClassSystemGroup, groupName, false, std::nullopt, groupName);
  makeContainer(alice_, QRVContainerClassAppData, name, false, std::nullopt, name);
  QRVError error;

  // The default seam knows no names.
  QRVContainerCache plain(env_.services->fileManager, env_.services->globalConfiguration,
                          env_.services->userIdentityCache, env_.sandbox);
  EXPECT_EQ(lookup(plain, system_, name, QRVContainerClassSystemData, &error), nullptr);
  EXPECT_EQ(error.code(), 21u);
  EXPECT_FALSE(plain.containerURL("/x/" + name, QRVContainerClassSystemData));

  wellKnown_->system = {name};
  wellKnown_->group = {groupName};
  auto cache = makeCache();
  auto s = lookup(*cache, system_, name, QRVContainerClassSystemData, &error);
  ASSERT_NE(s, nullptr) << error.description();
  EXPECT_EQ(s->url(), classDirectory(system_, QRVContainerClassSystemData) + "/" + name);
  EXPECT_NE(lookup(*cache, system_, groupName, QRVContainerClassSystemGroup, &error), nullptr);
  // A system name is not a group name, and data classes know no names.
  EXPECT_FALSE(cache->containerURL("/x/" + name, QRVContainerClassSystemGroup));
  EXPECT_EQ(lookup(*cache, alice_, name, QRVContainerClassAppData, &error), nullptr);
  EXPECT_EQ(error.code(), 21u);
}

// ---- Changes ----

TEST_F(ContainerCacheTest, AdditionsAndRemovalsKeepTheMapsCurrent) {
  auto cache = makeCache();
  QRVError error;
  auto m = makeContainer(alice_, QRVContainerClassAppData, "com.example.a");
  // An addition builds the map first (finding the container on disk too).
  ASSERT_TRUE(cache->addContainerMetadata(m, m->url(), false, false, &error)) << error.description();
  auto found = lookup(*cache, alice_, "com.example.a", QRVContainerClassAppData, &error);
  ASSERT_NE(found, nullptr);
  EXPECT_EQ(found->url(), m->url());

  // A moved container is recorded at its new place.
  const std::string moved = classDirectory(alice_, QRVContainerClassAppData) + "/" + QRVUUID::random().string();
  fs::rename(m->url(), moved);
  ASSERT_TRUE(cache->addContainerMetadata(m, moved, false, false, &error));
  found = lookup(*cache, alice_, "com.example.a", QRVContainerClassAppData, &error);
  ASSERT_NE(found, nullptr);
  EXPECT_EQ(found->url(), moved);
  EXPECT_EQ(m->url(), classDirectory(alice_, QRVContainerClassAppData) + "/" + m->uuid().string());  // unchanged

  // Stored transient entries say so.
  ASSERT_TRUE(cache->addContainerMetadata(m, moved, true, false, &error));
  found = lookup(*cache, alice_, "com.example.a", QRVContainerClassAppData, &error, true);
  ASSERT_NE(found, nullptr);
  EXPECT_TRUE(found->transient());

  ASSERT_TRUE(cache->removeContainerForUserIdentity(alice_, QRVContainerClassAppData, "com.example.a", false, &error));
  EXPECT_EQ(lookup(*cache, alice_, "com.example.a", QRVContainerClassAppData, &error), nullptr);
  EXPECT_EQ(error.code(), 21u);
  // Forgetting twice, or in a map never built, is fine.
  EXPECT_TRUE(cache->removeContainerForUserIdentity(alice_, QRVContainerClassAppData, "com.example.a", false, &error));
  EXPECT_TRUE(cache->removeContainerForUserIdentity(bob_, QRVContainerClassTempDir, "com.example.a", false, &error));

  EXPECT_FALSE(cache->removeContainerForUserIdentity(alice_, 14, "com.example.a", false, &error));
  EXPECT_EQ(error.code(), 46u);
  EXPECT_FALSE(cache->removeContainerForUserIdentity(nullptr, QRVContainerClassAppData, "x", false, &error));
  EXPECT_EQ(error.code(), 46u);
  EXPECT_FALSE(cache->addContainerMetadata(nullptr, "/x", false, false, &error));
  EXPECT_EQ(error.code(), 45u);
}

TEST_F(ContainerCacheTest, AClassDirectoryThatCannotBeListedIs43ForLookupsAnd45ForAdditions) {
  // A file where bob's class directory belongs.
  const std::string dir = bob_->homeDirectoryURL() + "/Containers/Data/Application";
  fs::create_directories(fs::path(dir).parent_path());
  std::ofstream(dir) << "not a directory";
  auto cache = makeCache();
  QRVError error;
  EXPECT_EQ(lookup(*cache, bob_, "com.example.a", QRVContainerClassAppData, &error), nullptr);
  EXPECT_EQ(error.code(), 43u);
  EXPECT_EQ(error.message(), "Cache: [502]-Data/Application: Failed to rebuild");
  ASSERT_NE(error.underlying(), nullptr);
  EXPECT_EQ(error.underlying()->code(), static_cast<uint64_t>(ENOTDIR));
  EXPECT_FALSE(cache->allContainersForUserIdentity(bob_, QRVContainerClassAppData, false, &error));
  EXPECT_EQ(error.code(), 43u);
  auto identity = QRVConcreteContainerIdentity::containerIdentityWithUUID(QRVUUID::random(), bob_, "com.example.a",
                                                                          QRVContainerClassAppData, nullptr);
  EXPECT_FALSE(cache->addContainerMetadata(QRVMetadata::make(*identity, QRVPlist(), "/x", ""), "/x", false, false,
                                           &error));
  EXPECT_EQ(error.code(), 45u);
  // Once the directory is back, the map is built (nothing failed was kept).
  fs::remove(dir);
  makeContainer(bob_, QRVContainerClassAppData, "com.example.a");
  EXPECT_NE(lookup(*cache, bob_, "com.example.a", QRVContainerClassAppData, &error), nullptr);
}

TEST_F(ContainerCacheTest, EntriesWithoutAUsablePathAre47) {
  auto cache = makeCache();
  auto m = makeContainer(alice_, QRVContainerClassAppData, "com.example.a");
  QRVError error;
  ASSERT_TRUE(cache->addContainerMetadata(m, "", false, false, &error));
  EXPECT_EQ(lookup(*cache, alice_, "com.example.a", QRVContainerClassAppData, &error), nullptr);
  EXPECT_EQ(error.code(), 47u);
  EXPECT_EQ(error.message().rfind("Cache: [501]-Data/Application: nil URL from <QRVMetadata: ", 0), 0u);
  ASSERT_TRUE(cache->addContainerMetadata(m, "relative/path", false, false, &error));
  EXPECT_EQ(lookup(*cache, alice_, "com.example.a", QRVContainerClassAppData, &error), nullptr);
  EXPECT_EQ(error.code(), 47u);
  EXPECT_EQ(error.message(), "Cache: [501]-Data/Application: Invalid URL path string: relative/path");
}

TEST_F(ContainerCacheTest, KeysNameTheUserOnlyWhereTheClassNeedsOne) {
  EXPECT_EQ(QRVContainerCache::cacheKey(alice_, QRVContainerClassAppData), "[501]-Data/Application");
  EXPECT_EQ(QRVContainerCache::cacheKey(bob_, QRVContainerClassAppGroup), "[502]-Shared/AppGroup");
  EXPECT_EQ(QRVContainerCache::cacheKey(alice_, QRVContainerClassAppBundle), "Bundle/Application");
  EXPECT_EQ(QRVContainerCache::cacheKey(nullptr, QRVContainerClassSystemGroup), "Shared/SystemGroup");
  EXPECT_EQ(QRVContainerCache::cacheKey(nullptr, QRVContainerClassAppData), "");
  EXPECT_EQ(QRVContainerCache::cacheKey(alice_, 0), "");
  EXPECT_EQ(QRVContainerCache::cacheKey(alice_, 14), "");
  usePersonas();
  EXPECT_EQ(QRVContainerCache::cacheKey(work_, QRVContainerClassAppData), "[WORK]-Data/Application");
}

TEST_F(ContainerCacheTest, AnExceptionInsideALookupIs40AndReleasesTheLock) {
  fs::create_directories(classDirectory(system_, QRVContainerClassSystemData) + "/not-a-uuid");
  makeContainer(alice_, QRVContainerClassAppData, "com.example.a");
  wellKnown_->throws = true;
  auto cache = makeCache();
  QRVError error;
  EXPECT_EQ(lookup(*cache, system_, "com.example.daemon", QRVContainerClassSystemData, &error), nullptr);
  EXPECT_EQ(error.code(), 40u);
  EXPECT_EQ(error.message().rfind("Got exception: well-known table unavailable : ", 0), 0u) << error.message();
  EXPECT_NE(lookup(*cache, alice_, "com.example.a", QRVContainerClassAppData, &error), nullptr);
}

TEST_F(ContainerCacheTest, ConcurrentUseKeepsEveryContainer) {
  constexpr int kThreads = 8, kPerThread = 20;
  std::vector<QRVMetadataRef> made;
  for (int i = 0; i < kThreads * kPerThread; i++)
    made.push_back(makeContainer(alice_, QRVContainerClassAppData, "com.example." + std::to_string(i)));
  auto cache = makeCache();
  std::atomic<int> failures{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; t++) {
    threads.emplace_back([&, t] {
      for (int i = t * kPerThread; i < (t + 1) * kPerThread; i++) {
        QRVError error;
        const QRVMetadataRef& m = made[static_cast<size_t>(i)];
        if (!lookup(*cache, alice_, m->identifier(), QRVContainerClassAppData, &error)) failures++;
        if (!cache->removeContainerForUserIdentity(alice_, QRVContainerClassAppData, m->identifier(), false, &error))
          failures++;
        if (!cache->addContainerMetadata(m, m->url(), false, false, &error)) failures++;
        if (!cache->allContainersForUserIdentity(alice_, QRVContainerClassAppData, false, &error)) failures++;
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(failures.load(), 0);
  auto all = cache->allContainersForUserIdentity(alice_, QRVContainerClassAppData, false, nullptr);
  ASSERT_TRUE(all);
  EXPECT_EQ(all->size(), made.size());
}

// ---- The sandbox facility ----

TEST_F(ContainerCacheTest, MappingsArePushedAsUserStateItemsByClass) {
  auto cache = makeCache();
  const std::string path = "/c/X";
  struct Case {
    QRVContainerClass c;
    uint64_t itemType;
    uint32_t uid;
  };
  for (const Case& k : {Case{2, 1, 501}, Case{4, 1, 501}, Case{6, 1, 501}, Case{9, 1, 501}, Case{10, 1, 501},
                        Case{11, 1, 501}, Case{7, 2, 501}, Case{12, 4, 0}, Case{13, 8, 0}}) {
    sandbox().userStateItems.clear();
    ASSERT_TRUE(cache->setSandboxContainerMappingForUserIdentity(bob_->withUID(501, 501), "com.example.x", k.c, path))
        << k.c;
    ASSERT_EQ(sandbox().userStateItems.size(), 2u) << k.c;
    QRVSandboxUserStateItem removal{k.uid, 1002, k.itemType, "com.example.x", std::nullopt};
    QRVSandboxUserStateItem mapping = removal;
    mapping.path = path;
    EXPECT_EQ(sandbox().userStateItems[0], removal) << k.c;
    EXPECT_EQ(sandbox().userStateItems[1], mapping) << k.c;
  }
  // Without a URL only the earlier mapping is removed.
  sandbox().userStateItems.clear();
  EXPECT_TRUE(cache->setSandboxContainerMappingForUserIdentity(alice_, "com.example.x", 7, std::nullopt));
  ASSERT_EQ(sandbox().userStateItems.size(), 1u);
  EXPECT_FALSE(sandbox().userStateItems[0].path);

  // Bundles have no mappings; unknown classes are refused.
  sandbox().userStateItems.clear();
  for (QRVContainerClass bundle : {1, 3, 5, 8})
    EXPECT_TRUE(cache->setSandboxContainerMappingForUserIdentity(alice_, "com.example.x", bundle, path));
  for (QRVContainerClass bad : {0, 14, 99})
    EXPECT_FALSE(cache->setSandboxContainerMappingForUserIdentity(alice_, "com.example.x", bad, path));
  EXPECT_TRUE(sandbox().userStateItems.empty());

  // A refusal of the removal stops before the mapping is set.
  sandbox().userStateResult = EIO;
  EXPECT_FALSE(cache->setSandboxContainerMappingForUserIdentity(alice_, "com.example.x", 2, path));
  EXPECT_EQ(sandbox().userStateItems.size(), 1u);
}

TEST_F(ContainerCacheTest, TheDecisionFollowsWhereTheApplicationIsInstalled) {
  usePersonas();
  auto cache = makeCache();
  // Installed only in WORK: only WORK's data container is mapped.
  EXPECT_TRUE(cache->shouldRegisterSandboxMappingWithUserIdentity(work_, "com.example.mail", 2));
  EXPECT_FALSE(cache->shouldRegisterSandboxMappingWithUserIdentity(other_, "com.example.mail", 2));
  EXPECT_FALSE(cache->shouldRegisterSandboxMappingWithUserIdentity(personal_, "com.example.mail", 2));
  EXPECT_FALSE(cache->shouldRegisterSandboxMappingWithUserIdentity(personal_, "com.example.unknown", 10));
  // Installed in WORK and the personal persona: every non-enterprise
  // identity, and no enterprise one.
  EXPECT_TRUE(cache->shouldRegisterSandboxMappingWithUserIdentity(personal_, "com.example.shared", 2));
  EXPECT_FALSE(cache->shouldRegisterSandboxMappingWithUserIdentity(work_, "com.example.shared", 2));
  EXPECT_FALSE(cache->shouldRegisterSandboxMappingWithUserIdentity(other_, "com.example.shared", 9));
  // Plug-ins are decided by their application once the parent is known.
  EXPECT_FALSE(cache->shouldRegisterSandboxMappingWithUserIdentity(work_, "com.example.mail.widget", 4));
  parents_->parents["com.example.mail.widget"] = "com.example.mail";
  EXPECT_TRUE(cache->shouldRegisterSandboxMappingWithUserIdentity(work_, "com.example.mail.widget", 4));
  EXPECT_TRUE(cache->shouldRegisterSandboxMappingWithUserIdentity(work_, "com.example.mail.widget", 6));
  // The parent matters only for plug-in classes.
  EXPECT_FALSE(cache->shouldRegisterSandboxMappingWithUserIdentity(work_, "com.example.mail.widget", 2));
  // Groups always; everything else unless the identity is enterprise.
  EXPECT_TRUE(cache->shouldRegisterSandboxMappingWithUserIdentity(other_, "group.example", 7));
  for (QRVContainerClass c : {1, 12, 13}) {
    EXPECT_FALSE(cache->shouldRegisterSandboxMappingWithUserIdentity(work_, "com.example.daemon", c)) << c;
    EXPECT_TRUE(cache->shouldRegisterSandboxMappingWithUserIdentity(personal_, "com.example.daemon", c)) << c;
  }
}

TEST_F(ContainerCacheTest, LookupsPushEachContainerOnceAndOnlyWhenAsked) {
  usePersonas();
  auto mail = makeContainer(work_, QRVContainerClassAppData, "com.example.mail");
  auto notes = makeContainer(work_, QRVContainerClassAppData, "com.example.notes");  // not installed in WORK
  auto cache = makeCache();
  QRVError error;
  ASSERT_NE(lookup(*cache, work_, "com.example.mail", QRVContainerClassAppData, &error), nullptr);
  EXPECT_TRUE(sandbox().userStateItems.empty());

  ASSERT_NE(lookup(*cache, work_, "com.example.mail", QRVContainerClassAppData, &error, false, true), nullptr);
  ASSERT_EQ(sandbox().userStateItems.size(), 2u);
  EXPECT_EQ(sandbox().userStateItems[1], (QRVSandboxUserStateItem{501, 1001, 1, "com.example.mail", mail->url()}));
  ASSERT_NE(lookup(*cache, work_, "com.example.mail", QRVContainerClassAppData, &error, false, true), nullptr);
  ASSERT_NE(lookup(*cache, work_, "com.example.notes", QRVContainerClassAppData, &error, false, true), nullptr);
  EXPECT_EQ(sandbox().userStateItems.size(), 2u);

  // A map built for a listing that populates pushes what should be pushed.
  sandbox().userStateItems.clear();
  auto fresh = makeCache();
  ASSERT_TRUE(fresh->allContainersForUserIdentity(work_, QRVContainerClassAppData, false, true, &error));
  ASSERT_EQ(sandbox().userStateItems.size(), 2u);
  EXPECT_EQ(sandbox().userStateItems[1].identifier, "com.example.mail");

  // Additions push when asked, once per place.
  sandbox().userStateItems.clear();
  auto group = makeContainer(other_, QRVContainerClassAppGroup, "group.example");
  ASSERT_TRUE(fresh->addContainerMetadata(group, group->url(), false, true, &error));
  ASSERT_EQ(sandbox().userStateItems.size(), 2u);
  EXPECT_EQ(sandbox().userStateItems[1], (QRVSandboxUserStateItem{501, 1002, 2, "group.example", group->url()}));
  ASSERT_TRUE(fresh->addContainerMetadata(group, group->url(), false, true, &error));
  EXPECT_EQ(sandbox().userStateItems.size(), 2u);
  const std::string moved = classDirectory(other_, QRVContainerClassAppGroup) + "/" + QRVUUID::random().string();
  fs::rename(group->url(), moved);
  ASSERT_TRUE(fresh->addContainerMetadata(group, moved, false, true, &error));
  ASSERT_EQ(sandbox().userStateItems.size(), 4u);
  EXPECT_EQ(sandbox().userStateItems[3].path, moved);

  // A facility that refuses does not fail the lookup.
  sandbox().userStateItems.clear();
  sandbox().userStateResult = EIO;
  auto refused = makeCache();
  EXPECT_NE(lookup(*refused, work_, "com.example.mail", QRVContainerClassAppData, &error, false, true), nullptr);
  EXPECT_EQ(sandbox().userStateItems.size(), 1u);
}

TEST_F(ContainerCacheTest, SystemContainersArePushedPerPersona) {
  usePersonas();
  auto daemon = makeContainer(system_, QRVContainerClassSystemData, "com.example.daemon");
  auto cache = makeCache();
  QRVError error;
  ASSERT_NE(lookup(*cache, work_, "com.example.daemon", QRVContainerClassSystemData, &error, false, true), nullptr);
  EXPECT_TRUE(sandbox().userStateItems.empty());  // enterprise personas get no system mappings
  ASSERT_NE(lookup(*cache, personal_, "com.example.daemon", QRVContainerClassSystemData, &error, false, true),
            nullptr);
  ASSERT_EQ(sandbox().userStateItems.size(), 2u);
  EXPECT_EQ(sandbox().userStateItems[1], (QRVSandboxUserStateItem{0, 1000, 4, "com.example.daemon", daemon->url()}));
}

}  // namespace

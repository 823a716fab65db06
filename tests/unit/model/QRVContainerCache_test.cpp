#include "model/QRVContainerCache.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <sys/stat.h>

#include <cerrno>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>
#include <map>
#include <set>
#include <stdexcept>
#include <thread>
#include <tuple>

#include "support/QRVTestServices.h"

namespace {

namespace fs = std::filesystem;
constexpr QRVContainerClass kData = QRVContainerClassAppData;
using Item = QRVSandboxUserStateItem;
using Op = QRVFaultInjectionFileSystem::Operation;

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
  std::vector<Item>& pushed() { return env_.sandbox->userStateItems; }

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

  QRVMetadataRef lookup(QRVContainerCache& cache, const QRVUserIdentityRef& u, const std::string& identifier,
                        QRVContainerClass c, QRVError* error, bool transient = false, bool updateSandbox = false) {
    auto identity = QRVContainerIdentity::containerIdentityWithUserIdentity(u, identifier, c, nullptr);
    return cache.containerForContainerIdentity(*identity, transient, updateSandbox, error);
  }
  // The code a lookup fails with; 0 when it finds the container.
  uint64_t lookupCode(QRVContainerCache& cache, const QRVUserIdentityRef& u, const std::string& identifier,
                      QRVContainerClass c = kData, bool transient = false, bool updateSandbox = false) {
    QRVError error;
    return lookup(cache, u, identifier, c, &error, transient, updateSandbox) ? 0 : error.code();
  }
  std::vector<std::string> allURLs(QRVContainerCache& cache, const QRVUserIdentityRef& u) {
    QRVError error;
    auto all = cache.allContainersForUserIdentity(u, kData, false, &error);
    EXPECT_TRUE(all) << error.description();
    std::vector<std::string> urls;
    for (const auto& m : all.value_or(std::vector<QRVMetadataRef>())) urls.push_back(m->url());
    return urls;
  }

  // A personal persona with the shared application and two enterprise
  // personas ("WORK" has the mail and the shared application, "OTHER"
  // nothing). The personal and WORK personas are universal: their bundle
  // lists say where each application is installed.
  void usePersonas() {
    env_.personas->supported = true;
    const std::vector<std::string> work = {"com.example.mail", "com.example.shared"}, shared = {"com.example.shared"};
    const std::string mobile = "/private/var/mobile";
    env_.personas->list = {{1000, 501, 501, QRVPersonaTypePersonal, "PERSONAL", mobile, shared, true, false},
                           {1001, 501, 501, QRVPersonaTypeEnterprise, "WORK", "/private/var/work", work, true, false},
                           {1002, 501, 501, QRVPersonaTypeEnterprise, "OTHER", "/private/var/other", {}, false, false}};
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

TEST_F(ContainerCacheTest, BuildsLazilyFromDiskOncePerUserIdentity) {
  auto a = makeContainer(alice_, kData, "com.example.a");
  auto c = makeContainer(alice_, kData, "com.example.c");
  auto b = makeContainer(alice_, kData, "com.example.b");
  // Of two directories claiming one identifier the last listed wins.
  makeContainer(alice_, kData, "com.example.twice", false, QRVUUID::fromString("00000000-0000-4000-8000-000000000001"));
  auto last = makeContainer(alice_, kData, "com.example.twice", false,
                            QRVUUID::fromString("FFFFFFFF-FFFF-4FFF-8FFF-FFFFFFFFFFFF"));
  // The daemon's own instance is wired to its services.
  QRVContainerCache& cache = *env_.services->containerCache;
  QRVError error;
  auto found = cache.containerForContainerIdentity(
      *QRVContainerIdentity::containerIdentityWithUserIdentity(alice_, "com.example.a", kData, nullptr), &error);
  ASSERT_NE(found, nullptr) << error.description();
  EXPECT_EQ(found->uuid(), a->uuid());
  EXPECT_FALSE(found->transient());
  EXPECT_EQ(allURLs(cache, alice_), (std::vector<std::string>{a->url(), b->url(), c->url(), last->url()}));

  // Built once: a container made behind the cache's back is not seen until
  // the map is built again.
  makeContainer(alice_, kData, "com.example.d");
  EXPECT_EQ(lookupCode(cache, alice_, "com.example.d"), 21u);
  EXPECT_EQ(lookupCode(*makeCache(), alice_, "com.example.d"), 0u);
  // Maps are per user identity.
  EXPECT_EQ(lookupCode(cache, bob_, "com.example.a"), 21u);
  EXPECT_TRUE(allURLs(cache, bob_).empty());
}

TEST_F(ContainerCacheTest, AVanishedMetadataFileIs44ThenNotFound) {
  auto a = makeContainer(alice_, kData, "com.example.a");
  auto cache = makeCache();
  ASSERT_EQ(lookupCode(*cache, alice_, "com.example.a"), 0u);
  ASSERT_TRUE(fs::remove(a->metadataFileURL()));
  EXPECT_EQ(lookupCode(*cache, alice_, "com.example.a"), 44u);
  EXPECT_EQ(lookupCode(*cache, alice_, "com.example.a"), 21u);

  // Once the container is whole again and recorded, it is found.
  QRVError error;
  ASSERT_TRUE(a->writeMetadataToDisk(fm(), config(), &error));
  ASSERT_TRUE(cache->addContainerMetadata(a, a->url(), /*transient=*/false, /*updateSandbox=*/false, &error));
  EXPECT_EQ(lookupCode(*cache, alice_, "com.example.a"), 0u);
}

// A look-up checks that the metadata file is still there without the lock:
// another look-up is answered meanwhile, and an entry replaced meanwhile is
// not dropped for the old container's missing file.
TEST_F(ContainerCacheTest, TheMetadataFileCheckHoldsNoLock) {
  auto a = makeContainer(alice_, kData, "com.example.a");
  makeContainer(bob_, kData, "com.example.bob");
  auto cache = makeCache();
  ASSERT_EQ(lookupCode(*cache, alice_, "com.example.a"), 0u);
  ASSERT_EQ(lookupCode(*cache, bob_, "com.example.bob"), 0u);

  std::promise<void> reached, release;
  std::shared_future<void> released = release.get_future().share();
  std::atomic<bool> first{true};
  env_.posixFileSystem->setHook(Op::kStatus, [&](const std::string& path) {
    if (path != a->metadataFileURL() || !first.exchange(false)) return;
    reached.set_value();
    released.wait();
  });
  auto stopped = std::async(std::launch::async, [&] { return lookupCode(*cache, alice_, "com.example.a"); });
  if (reached.get_future().wait_for(std::chrono::seconds(30)) != std::future_status::ready) {
    release.set_value();
    FAIL() << "the look-up never checked the metadata file";
  }
  auto other = std::async(std::launch::async, [&] { return lookupCode(*cache, bob_, "com.example.bob"); });
  const bool served = other.wait_for(std::chrono::seconds(30)) == std::future_status::ready;
  EXPECT_TRUE(served) << "a look-up waited for another one's file check";
  if (served) {
    auto b = makeContainer(alice_, kData, "com.example.a");
    QRVError error;
    ASSERT_TRUE(cache->addContainerMetadata(b, b->url(), /*transient=*/false, /*updateSandbox=*/false, &error));
    ASSERT_TRUE(fs::remove(a->metadataFileURL()));
  }
  release.set_value();
  EXPECT_EQ(stopped.get(), served ? 44u : 0u);
  env_.posixFileSystem->setHook(Op::kStatus, nullptr);
  if (served) {
    EXPECT_EQ(other.get(), 0u);
    QRVError error;
    auto found = lookup(*cache, alice_, "com.example.a", kData, &error);
    ASSERT_NE(found, nullptr) << error.description();
    EXPECT_NE(found->url(), a->url());
  }
}

TEST_F(ContainerCacheTest, TransientAndLiveContainersAreIndexedApart) {
  auto live = makeContainer(alice_, kData, "com.example.a");
  auto temporary = makeContainer(alice_, kData, "com.example.a", true);
  auto cache = makeCache();
  QRVError error;
  auto l = lookup(*cache, alice_, "com.example.a", kData, &error, false);
  auto t = lookup(*cache, alice_, "com.example.a", kData, &error, true);
  ASSERT_TRUE(l && t);
  EXPECT_EQ(l->url(), live->url());
  EXPECT_FALSE(l->transient());
  EXPECT_EQ(t->url(), temporary->url());
  EXPECT_TRUE(t->transient());

  ASSERT_TRUE(cache->removeContainerForUserIdentity(alice_, kData, "com.example.a", true, &error));
  EXPECT_EQ(lookupCode(*cache, alice_, "com.example.a", kData, true), 21u);
  EXPECT_EQ(lookupCode(*cache, alice_, "com.example.a", kData, false), 0u);
}

TEST_F(ContainerCacheTest, OnlyValidEntriesBecomeContainers) {
  const std::string dir = classDirectory(alice_, kData);
  auto good = makeContainer(alice_, kData, "com.example.good");
  makeContainer(alice_, kData, "com.example.named", false, std::nullopt, "Junk");
  // A regular file, an empty directory and a directory with garbage where
  // the metadata belongs, all with UUID names.
  std::ofstream(dir + "/" + QRVUUID::random().string()) << "file";
  fs::create_directory(dir + "/" + QRVUUID::random().string());
  std::string garbage = dir + "/" + QRVUUID::random().string();
  fs::create_directory(garbage);
  std::ofstream(garbage + "/" + QRVMetadata::kFileName) << "bplist00 garbage";
  // Another user's container, and a plug-in container, in alice's tree.
  auto bobs = makeContainer(bob_, kData, "com.example.bob");
  fs::rename(bobs->url(), dir + "/" + bobs->uuid().string());
  auto plugin = makeContainer(alice_, QRVContainerClassPluginData, "com.example.plugin");
  fs::rename(plugin->url(), dir + "/" + plugin->uuid().string());
  // A link named like a container, to a good container outside the tree.
  const std::string outside = env_.root.path() + "/outside/Data/Application";
  fs::create_directories(outside);
  auto elsewhere = makeContainer(alice_, kData, "com.example.linked");
  fs::rename(elsewhere->url(), outside + "/" + elsewhere->uuid().string());
  fs::create_directory_symlink(outside + "/" + elsewhere->uuid().string(), dir + "/" + QRVUUID::random().string());

  auto cache = makeCache();
  EXPECT_EQ(allURLs(*cache, alice_), std::vector<std::string>{good->url()});
  for (const char* skipped : {"com.example.named", "com.example.bob", "com.example.plugin", "com.example.linked"})
    EXPECT_EQ(lookupCode(*cache, alice_, skipped), 21u) << skipped;
  // Nothing outside the tree was changed.
  EXPECT_TRUE(fs::exists(outside + "/" + elsewhere->uuid().string() + "/" + QRVMetadata::kFileName));
}

TEST_F(ContainerCacheTest, WellKnownNamesCountForSystemClassesOnly) {
  const std::string name = "com.example.wellknown", groupName = "systemgroup.com.example.shared";
  makeContainer(system_, QRVContainerClassSystemData, name, false, std::nullopt, name);
  makeContainer(system_, QRVContainerClassSystemGroup, groupName, false, std::nullopt, groupName);
  makeContainer(alice_, kData, name, false, std::nullopt, name);
  EXPECT_EQ(lookupCode(*makeCache(), system_, name, QRVContainerClassSystemData), 21u);
  wellKnown_->system = {name};
  wellKnown_->group = {groupName};
  auto cache = makeCache();
  QRVError error;
  auto s = lookup(*cache, system_, name, QRVContainerClassSystemData, &error);
  ASSERT_NE(s, nullptr) << error.description();
  EXPECT_EQ(s->url(), classDirectory(system_, QRVContainerClassSystemData) + "/" + name);
  EXPECT_EQ(lookupCode(*cache, system_, groupName, QRVContainerClassSystemGroup), 0u);
  // A system name is not a group name, and data classes know no names.
  EXPECT_FALSE(cache->containerURL("/x/" + name, QRVContainerClassSystemGroup));
  EXPECT_EQ(lookupCode(*cache, alice_, name), 21u);
}

// Many containers, so that the build reads on several threads, among every
// kind of entry a user can plant: the map holds exactly what reading each
// entry on its own, by path, accepts.
TEST_F(ContainerCacheTest, AParallelBuildAcceptsWhatReadingEachEntryByPathAccepts) {
  const std::string dir = classDirectory(alice_, kData);
  for (int i = 0; i < 300; i++) makeContainer(alice_, kData, "com.example." + std::to_string(i));
  auto planted = [&](const std::string& what) {
    std::string path = dir + "/" + QRVUUID::random().string();
    fs::create_directory(path);
    return path + "/" + (what.empty() ? QRVMetadata::kFileName : what);
  };
  std::string outside = env_.root.path() + "/outside";
  fs::create_directories(outside);
  auto elsewhere = makeContainer(alice_, kData, "com.example.linked");
  fs::rename(elsewhere->url(), outside + "/c");
  for (int i = 0; i < 20; i++) {
    // A link in the container's place, and one in the metadata file's.
    fs::create_directory_symlink(outside + "/c", dir + "/" + QRVUUID::random().string());
    fs::create_symlink(outside + "/c/" + QRVMetadata::kFileName, planted(""));
    std::ofstream(planted("")) << "bplist00 garbage";   // corrupt
    std::ofstream(planted("")) << "<plist><array/></plist>";  // not a dictionary
    fs::create_directory(planted(""));                   // a directory
    ASSERT_EQ(mkfifo(planted("").c_str(), 0600), 0);     // a fifo, never blocked on
    planted("other-name");                               // no metadata at all
    std::ofstream(dir + "/" + QRVUUID::random().string()) << "a file";
    makeContainer(alice_, kData, "com.example.junk" + std::to_string(i), false, std::nullopt, "Junk" + std::to_string(i));
  }
  // The same identifier twice: the last listed wins, as before.
  makeContainer(alice_, kData, "com.example.7", false, QRVUUID::fromString("00000000-0000-4000-8000-000000000001"));
  makeContainer(alice_, kData, "com.example.7", false, QRVUUID::fromString("FFFFFFFF-FFFF-4FFF-8FFF-FFFFFFFFFFFF"));

  // The model: every listed entry read alone, by path, in listing order.
  std::map<std::string, QRVMetadataRef> expected;
  QRVError error;
  auto cache = makeCache();
  auto listed = fm().urlsForItemsInDirectoryAtURL(dir, &error);
  ASSERT_TRUE(listed) << error.description();
  for (const std::string& url : *listed) {
    if (!cache->containerURL(url, kData)) continue;
    if (auto m = QRVMetadata::readAndValidateMetadataAtUrl(url, alice_, true, fm(), identities(), nullptr))
      expected[m->identifier()] = m;
  }
  ASSERT_EQ(expected.size(), 300u);
  const int opensBefore = env_.posixFileSystem->calls(Op::kOpenResolved);
  auto all = cache->allContainersForUserIdentity(alice_, kData, false, &error);
  ASSERT_TRUE(all) << error.description();
  ASSERT_EQ(all->size(), expected.size());
  for (const QRVMetadataRef& m : *all) {
    const QRVMetadataRef& e = expected[m->identifier()];
    ASSERT_TRUE(e) << m->identifier();
    EXPECT_EQ(m->url(), e->url());
    EXPECT_EQ(m->uuid(), e->uuid());
    EXPECT_EQ(m->plist(), e->plist());
    EXPECT_TRUE(m->userIdentity()->isEqualToUserIdentity(*e->userIdentity()));
  }
  EXPECT_EQ(lookup(*cache, alice_, "com.example.7", kData, &error)->uuid().string(),
            "FFFFFFFF-FFFF-4FFF-8FFF-FFFFFFFFFFFF");
  // One open per good container, below the class directory.
  EXPECT_GE(env_.posixFileSystem->calls(Op::kOpenResolved) - opensBefore, 300);
  // Nothing outside the tree was changed.
  EXPECT_TRUE(fs::exists(outside + "/c/" + QRVMetadata::kFileName));
}

TEST_F(ContainerCacheTest, ABuildOutOfDescriptorsMidwayPublishesNothingAndTheNextLookupBuildsAgain) {
  for (int i = 0; i < 100; i++) makeContainer(alice_, kData, "com.example." + std::to_string(i));
  auto cache = makeCache();
  env_.posixFileSystem->inject(Op::kOpenResolved, {EMFILE, 60, 1, QRVMetadata::kFileName});
  QRVError error;
  EXPECT_EQ(lookup(*cache, alice_, "com.example.1", kData, &error), nullptr);
  EXPECT_EQ(error.code(), 43u);
  // Nothing half-read was kept: the next lookup reads every container.
  const int opens = env_.posixFileSystem->calls(Op::kOpenResolved);
  EXPECT_EQ(lookupCode(*cache, alice_, "com.example.99"), 0u);
  EXPECT_EQ(env_.posixFileSystem->calls(Op::kOpenResolved) - opens, 100);
  EXPECT_EQ(allURLs(*cache, alice_).size(), 100u);

  // Any other failure of the one open is asked again one component at a
  // time, and only that container is left out, as a read by path would.
  auto other = makeCache();
  env_.posixFileSystem->inject(Op::kOpenResolved, {ENOSYS, 1, QRVFaultInjectionFileSystem::kForever, ""});
  EXPECT_EQ(allURLs(*other, alice_).size(), 100u);
  env_.posixFileSystem->clearFaults();
}

// A build holds no lock while it reads. Alice's build is held with every
// metadata read stopped but that of "removed", listed first, whose file is
// open by then: another class is served meanwhile, and a removal of
// "removed" and an addition made after the listing wait for the build and
// are applied to the map it publishes, neither lost nor undone.
TEST_F(ContainerCacheTest, ABuildInProgressBlocksOnlyItsOwnClassAndLosesNoChange) {
  auto removed = makeContainer(alice_, kData, "com.example.removed", false,
                               QRVUUID::fromString("00000000-0000-4000-8000-000000000000"));
  for (int i = 0; i < 50; i++) makeContainer(alice_, kData, "com.example." + std::to_string(i));
  makeContainer(bob_, kData, "com.example.bob");
  auto cache = makeCache();
  // Bob's map first, so that the hooks stop alice's build only.
  ASSERT_EQ(lookupCode(*cache, bob_, "com.example.bob"), 0u);

  std::promise<void> reached, release;
  std::shared_future<void> released = release.get_future().share();
  std::atomic<bool> first{true};
  const std::string removedName = removed->uuid().string();
  env_.posixFileSystem->setHook(Op::kOpenResolved, [&](const std::string& path) {
    if (path.find(removedName) == std::string::npos) released.wait();
  });
  env_.posixFileSystem->setHook(Op::kRead, [&](const std::string& path) {
    if (path.find(removedName) != std::string::npos && first.exchange(false)) reached.set_value();
  });

  auto building = std::async(std::launch::async, [&] { return lookupCode(*cache, alice_, "com.example.1"); });
  if (reached.get_future().wait_for(std::chrono::seconds(30)) != std::future_status::ready) {
    release.set_value();
    FAIL() << "alice's build never read the first container";
  }
  // Served while alice's build is stopped.
  auto other = std::async(std::launch::async, [&] {
    return lookupCode(*cache, bob_, "com.example.bob") + lookupCode(*cache, system_, "x", QRVContainerClassSystemData);
  });
  bool served = other.wait_for(std::chrono::seconds(30)) == std::future_status::ready;
  EXPECT_TRUE(served) << "another class waited for alice's build";

  // A deletion and a creation after the build listed the directory.
  fs::remove_all(removed->url());
  auto added = makeContainer(alice_, kData, "com.example.added");
  auto removal = std::async(std::launch::async, [&] {
    QRVError error;
    return cache->removeContainerForUserIdentity(alice_, kData, "com.example.removed", false, &error);
  });
  auto addition = std::async(std::launch::async, [&] {
    QRVError error;
    return cache->addContainerMetadata(added, added->url(), /*transient=*/false, /*updateSandbox=*/false, &error);
  });
  // Both have had time to reach the cache; a wrong cache applies them now,
  // under the build.
  EXPECT_EQ(removal.wait_for(std::chrono::milliseconds(200)), std::future_status::timeout);
  release.set_value();
  EXPECT_EQ(building.get(), 0u);
  EXPECT_TRUE(removal.get());
  EXPECT_TRUE(addition.get());
  // Bob's container is found (0); the system class has no "x" (21).
  if (served) {
    EXPECT_EQ(other.get(), 21u);
  }
  env_.posixFileSystem->setHook(Op::kOpenResolved, nullptr);
  env_.posixFileSystem->setHook(Op::kRead, nullptr);

  EXPECT_EQ(lookupCode(*cache, alice_, "com.example.removed"), 21u);
  EXPECT_EQ(lookupCode(*cache, alice_, "com.example.added"), 0u);
  EXPECT_EQ(allURLs(*cache, alice_).size(), 51u);
}

// ---- Changes ----

TEST_F(ContainerCacheTest, AdditionsAndRemovalsKeepTheMapsCurrent) {
  auto cache = makeCache();
  QRVError error;
  auto m = makeContainer(alice_, kData, "com.example.a");
  // An addition builds the map first (finding the container on disk too).
  ASSERT_TRUE(cache->addContainerMetadata(m, m->url(), /*transient=*/false, /*updateSandbox=*/false, &error))
      << error.description();
  EXPECT_EQ(allURLs(*cache, alice_), std::vector<std::string>{m->url()});

  // A moved container is recorded at its new place.
  const std::string moved = classDirectory(alice_, kData) + "/" + QRVUUID::random().string();
  fs::rename(m->url(), moved);
  ASSERT_TRUE(cache->addContainerMetadata(m, moved, /*transient=*/false, /*updateSandbox=*/false, &error));
  EXPECT_EQ(allURLs(*cache, alice_), std::vector<std::string>{moved});
  // Stored transient entries say so.
  ASSERT_TRUE(cache->addContainerMetadata(m, moved, /*transient=*/true, /*updateSandbox=*/false, &error));
  auto found = lookup(*cache, alice_, "com.example.a", kData, &error, true);
  ASSERT_NE(found, nullptr);
  EXPECT_TRUE(found->transient());

  ASSERT_TRUE(cache->removeContainerForUserIdentity(alice_, kData, "com.example.a", false, &error));
  EXPECT_EQ(lookupCode(*cache, alice_, "com.example.a"), 21u);
  // Forgetting twice, or in a map never built, is fine.
  EXPECT_TRUE(cache->removeContainerForUserIdentity(alice_, kData, "com.example.a", false, &error));
  EXPECT_TRUE(cache->removeContainerForUserIdentity(bob_, QRVContainerClassTempDir, "com.example.a", false, &error));

  auto code = [&](bool ok) { return ok ? 0 : std::exchange(error, QRVError()).code(); };
  EXPECT_EQ(code(cache->removeContainerForUserIdentity(alice_, 14, "com.example.a", false, &error)), 46u);
  EXPECT_EQ(code(cache->removeContainerForUserIdentity(nullptr, kData, "x", false, &error)), 46u);
  EXPECT_EQ(code(cache->addContainerMetadata(nullptr, "/x", /*transient=*/false, /*updateSandbox=*/false, &error)),
            45u);
}

TEST_F(ContainerCacheTest, UnlistableDirectoriesAre43Or45AndUnusablePathsAre47) {
  // A file where bob's class directory belongs.
  const std::string dir = bob_->homeDirectoryURL() + "/Containers/Data/Application";
  fs::create_directories(fs::path(dir).parent_path());
  std::ofstream(dir) << "not a directory";
  auto cache = makeCache();
  QRVError error;
  EXPECT_EQ(lookup(*cache, bob_, "com.example.a", kData, &error), nullptr);
  EXPECT_EQ(error.code(), 43u);
  ASSERT_NE(error.underlying(), nullptr);
  EXPECT_EQ(error.underlying()->code(), static_cast<uint64_t>(ENOTDIR));
  EXPECT_FALSE(cache->allContainersForUserIdentity(bob_, kData, false, &error));
  EXPECT_EQ(error.code(), 43u);
  auto identity =
      QRVConcreteContainerIdentity::containerIdentityWithUUID(QRVUUID::random(), bob_, "com.example.a", kData, nullptr);
  EXPECT_FALSE(cache->addContainerMetadata(QRVMetadata::make(*identity, QRVPlist(), "/x", ""), "/x",
                                           /*transient=*/false, /*updateSandbox=*/false, &error));
  EXPECT_EQ(error.code(), 45u);
  // Once the directory is back, the map is built (nothing failed was kept).
  fs::remove(dir);
  makeContainer(bob_, kData, "com.example.a");
  EXPECT_EQ(lookupCode(*cache, bob_, "com.example.a"), 0u);

  auto m = makeContainer(alice_, kData, "com.example.a");
  for (const char* unusable : {"", "relative/path"}) {
    ASSERT_TRUE(cache->addContainerMetadata(m, unusable, /*transient=*/false, /*updateSandbox=*/false, &error));
    EXPECT_EQ(lookupCode(*cache, alice_, "com.example.a"), 47u) << unusable;
  }
}

TEST_F(ContainerCacheTest, KeysNameTheUserOnlyWhereTheClassNeedsOne) {
  EXPECT_EQ(QRVContainerCache::cacheKey(alice_, kData), "[501]-Data/Application");
  EXPECT_EQ(QRVContainerCache::cacheKey(alice_, QRVContainerClassAppBundle), "Bundle/Application");
  EXPECT_EQ(QRVContainerCache::cacheKey(nullptr, QRVContainerClassSystemGroup), "Shared/SystemGroup");
  // Personas of one uid are kept apart.
  usePersonas();
  EXPECT_EQ(QRVContainerCache::cacheKey(work_, kData), "[WORK]-Data/Application");
}

// ---- Locking ----

TEST_F(ContainerCacheTest, AnExceptionInsideALookupIs40AndReleasesTheLock) {
  fs::create_directories(classDirectory(system_, QRVContainerClassSystemData) + "/not-a-uuid");
  makeContainer(alice_, kData, "com.example.a");
  wellKnown_->throws = true;
  auto cache = makeCache();
  QRVError error;
  EXPECT_EQ(lookup(*cache, system_, "com.example.daemon", QRVContainerClassSystemData, &error), nullptr);
  EXPECT_EQ(error.code(), 40u);
  EXPECT_EQ(error.message().rfind("Got exception: well-known table unavailable : ", 0), 0u) << error.message();
  EXPECT_EQ(lookupCode(*cache, alice_, "com.example.a"), 0u);
}

TEST_F(ContainerCacheTest, ConcurrentUseKeepsEveryContainer) {
  constexpr int kThreads = 8, kPerThread = 20;
  std::vector<QRVMetadataRef> made;
  for (int i = 0; i < kThreads * kPerThread; i++)
    made.push_back(makeContainer(alice_, kData, "com.example." + std::to_string(i)));
  auto cache = makeCache();
  std::atomic<int> failures{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; t++) {
    threads.emplace_back([&, t] {
      for (int i = t * kPerThread; i < (t + 1) * kPerThread; i++) {
        QRVError error;
        const QRVMetadataRef& m = made[static_cast<size_t>(i)];
        if (!lookup(*cache, alice_, m->identifier(), kData, &error)) failures++;
        if (!cache->removeContainerForUserIdentity(alice_, kData, m->identifier(), false, &error)) failures++;
        if (!cache->addContainerMetadata(m, m->url(), /*transient=*/false, /*updateSandbox=*/false, &error)) failures++;
        if (!cache->allContainersForUserIdentity(alice_, kData, false, &error)) failures++;
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(failures.load(), 0);
  EXPECT_EQ(allURLs(*cache, alice_).size(), made.size());
}

// ---- The sandbox facility ----

TEST_F(ContainerCacheTest, MappingsArePushedAsUserStateItemsByClass) {
  auto cache = makeCache();
  const std::string path = "/c/X";
  using Case = std::tuple<QRVContainerClass, uint64_t, uint32_t>;  // class, item type, uid
  for (auto [c, itemType, uid] : {Case{2, 1, 501}, Case{4, 1, 501}, Case{6, 1, 501}, Case{9, 1, 501}, Case{10, 1, 501},
                                  Case{11, 1, 501}, Case{7, 2, 501}, Case{12, 4, 0}, Case{13, 8, 0}}) {
    SCOPED_TRACE(c);
    pushed().clear();
    ASSERT_TRUE(cache->setSandboxContainerMappingForUserIdentity(bob_->withUID(501, 501), "com.example.x", c, path));
    // First the removal of any earlier mapping, then the mapping.
    Item removal{uid, 1002, itemType, "com.example.x", std::nullopt}, mapping = removal;
    mapping.path = path;
    EXPECT_EQ(pushed(), (std::vector<Item>{removal, mapping}));
  }
  // Without a URL only the earlier mapping is removed.
  pushed().clear();
  EXPECT_TRUE(cache->setSandboxContainerMappingForUserIdentity(alice_, "com.example.x", 7, std::nullopt));
  ASSERT_EQ(pushed().size(), 1u);
  EXPECT_FALSE(pushed()[0].path);

  // Bundles have no mappings; unknown classes are refused.
  pushed().clear();
  for (QRVContainerClass bundle : {1, 3, 5, 8})
    EXPECT_TRUE(cache->setSandboxContainerMappingForUserIdentity(alice_, "com.example.x", bundle, path));
  for (QRVContainerClass bad : {0, 14, 99})
    EXPECT_FALSE(cache->setSandboxContainerMappingForUserIdentity(alice_, "com.example.x", bad, path));
  EXPECT_TRUE(pushed().empty());

  // A refusal of the removal stops before the mapping is set.
  env_.sandbox->userStateResult = EIO;
  EXPECT_FALSE(cache->setSandboxContainerMappingForUserIdentity(alice_, "com.example.x", 2, path));
  EXPECT_EQ(pushed().size(), 1u);
}

TEST_F(ContainerCacheTest, TheDecisionFollowsWhereTheApplicationIsInstalled) {
  usePersonas();
  auto cache = makeCache();
  auto decide = [&](const QRVUserIdentityRef& u, const std::string& identifier, QRVContainerClass c) {
    return cache->shouldRegisterSandboxMappingWithUserIdentity(u, identifier, c);
  };
  // Installed only in WORK: only WORK's data container is mapped.
  EXPECT_TRUE(decide(work_, "com.example.mail", 2));
  EXPECT_FALSE(decide(other_, "com.example.mail", 2));
  EXPECT_FALSE(decide(personal_, "com.example.mail", 2));
  EXPECT_FALSE(decide(personal_, "com.example.unknown", 10));
  // Installed in WORK and the personal persona: every non-enterprise
  // identity, and no enterprise one.
  EXPECT_TRUE(decide(personal_, "com.example.shared", 2));
  EXPECT_FALSE(decide(work_, "com.example.shared", 2));
  EXPECT_FALSE(decide(other_, "com.example.shared", 9));
  // Plug-ins are decided by their application once the parent is known, and
  // the parent matters only for plug-in classes.
  EXPECT_FALSE(decide(work_, "com.example.mail.widget", 4));
  parents_->parents["com.example.mail.widget"] = "com.example.mail";
  EXPECT_TRUE(decide(work_, "com.example.mail.widget", 4));
  EXPECT_TRUE(decide(work_, "com.example.mail.widget", 6));
  EXPECT_FALSE(decide(work_, "com.example.mail.widget", 2));
  // Groups always; everything else unless the identity is enterprise.
  EXPECT_TRUE(decide(other_, "group.example", 7));
  for (QRVContainerClass c : {1, 12, 13}) {
    EXPECT_FALSE(decide(work_, "com.example.daemon", c)) << c;
    EXPECT_TRUE(decide(personal_, "com.example.daemon", c)) << c;
  }
}

TEST_F(ContainerCacheTest, LookupsPushEachContainerOncePerIdentityAndOnlyWhenAsked) {
  usePersonas();
  auto mail = makeContainer(work_, kData, "com.example.mail");
  makeContainer(work_, kData, "com.example.notes");  // not installed in WORK
  auto daemon = makeContainer(system_, QRVContainerClassSystemData, "com.example.daemon");
  auto cache = makeCache();
  ASSERT_EQ(lookupCode(*cache, work_, "com.example.mail"), 0u);
  EXPECT_TRUE(pushed().empty());
  ASSERT_EQ(lookupCode(*cache, work_, "com.example.mail", kData, false, true), 0u);
  EXPECT_EQ(pushed(), (std::vector<Item>{{501, 1001, 1, "com.example.mail", std::nullopt},
                                         {501, 1001, 1, "com.example.mail", mail->url()}}));
  ASSERT_EQ(lookupCode(*cache, work_, "com.example.mail", kData, false, true), 0u);
  ASSERT_EQ(lookupCode(*cache, work_, "com.example.notes", kData, false, true), 0u);
  EXPECT_EQ(pushed().size(), 2u);

  // One system container, one map: each persona is decided for on its own.
  pushed().clear();
  ASSERT_EQ(lookupCode(*cache, work_, "com.example.daemon", QRVContainerClassSystemData, false, true), 0u);
  EXPECT_TRUE(pushed().empty());  // enterprise personas get no system mappings
  ASSERT_EQ(lookupCode(*cache, personal_, "com.example.daemon", QRVContainerClassSystemData, false, true), 0u);
  ASSERT_EQ(pushed().size(), 2u);
  EXPECT_EQ(pushed()[1], (Item{0, 1000, 4, "com.example.daemon", daemon->url()}));

  // A map built for a listing that populates pushes what should be pushed.
  pushed().clear();
  auto fresh = makeCache();
  QRVError error;
  ASSERT_TRUE(
      fresh->allContainersForUserIdentity(work_, kData, /*transient=*/false, /*populateSandboxCache=*/true, &error));
  ASSERT_EQ(pushed().size(), 2u);
  EXPECT_EQ(pushed()[1].identifier, "com.example.mail");

  // Additions push when asked, once per place.
  pushed().clear();
  auto group = makeContainer(other_, QRVContainerClassAppGroup, "group.example");
  ASSERT_TRUE(fresh->addContainerMetadata(group, group->url(), /*transient=*/false, /*updateSandbox=*/true, &error));
  ASSERT_EQ(pushed().size(), 2u);
  EXPECT_EQ(pushed()[1], (Item{501, 1002, 2, "group.example", group->url()}));
  ASSERT_TRUE(fresh->addContainerMetadata(group, group->url(), /*transient=*/false, /*updateSandbox=*/true, &error));
  EXPECT_EQ(pushed().size(), 2u);
  const std::string moved = classDirectory(other_, QRVContainerClassAppGroup) + "/" + QRVUUID::random().string();
  fs::rename(group->url(), moved);
  ASSERT_TRUE(fresh->addContainerMetadata(group, moved, /*transient=*/false, /*updateSandbox=*/true, &error));
  ASSERT_EQ(pushed().size(), 4u);
  EXPECT_EQ(pushed()[3].path, moved);

  // A facility that refuses does not fail the lookup.
  pushed().clear();
  env_.sandbox->userStateResult = EIO;
  EXPECT_EQ(lookupCode(*makeCache(), work_, "com.example.mail", kData, false, true), 0u);
  EXPECT_EQ(pushed().size(), 1u);
}

}  // namespace

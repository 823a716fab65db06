// The code-signing mapping over a real database file and real containers on
// a temporary root. Deletions it decides on are read from the request's
// command queue (and, where it matters, run to see the container go).
#include "codesigning/QRVCodeSigningMapping.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <atomic>
#include <chrono>
#include <fstream>
#include <future>
#include <iterator>
#include <random>
#include <thread>

#include "codesigning/QRVSQLiteSchema.h"
#include "core/QRVCommandQueue.h"
#include "core/QRVCommandStageForDelete.h"
#include "migration/QRVMigrationStatus.h"
#include "support/QRVContainerTest.h"
#include "support/QRVLogCapture.h"

namespace fs = std::filesystem;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::UnorderedElementsAre;

namespace {

using Strings = std::vector<std::string>;

QRVPlist stringArray(const Strings& values) {
  QRVPlist array = QRVPlist::array();
  for (const auto& v : values) array.append(QRVPlist::string(v));
  return array;
}

// Entitlements claiming application groups, system groups and (optionally)
// a system container.
QRVPlist entitlements(const Strings& appGroups, const Strings& systemGroups = {}, bool systemContainer = false) {
  QRVPlist e = QRVPlist::dictionary();
  if (!appGroups.empty()) e.set(kQRVApplicationGroupsEntitlement, stringArray(appGroups));
  if (!systemGroups.empty()) e.set(kQRVSystemGroupsEntitlement, stringArray(systemGroups));
  if (systemContainer) e.set(kQRVSystemContainerEntitlement, QRVPlist::boolean(true));
  return e;
}

QRVPlist info(const QRVPlist& ents) {
  QRVPlist i = QRVPlist::dictionary();
  i.set(kQRVCodeSigningEntitlementsKey, ents);
  return i;
}

QRVPlist option(const char* key, QRVPlist value) {
  QRVPlist o = QRVPlist::dictionary();
  o.set(key, std::move(value));
  return o;
}

// "identifier/class/user" of every container the queue will stage. The
// mapping's own deletions take the identifier locks when they run; the
// boot-time sweep's do not.
Strings staged(QRVCommandQueue& queue, bool withLocking = true) {
  Strings out;
  for (const auto& command : queue.TEST_pendingCommands()) {
    auto stage = std::dynamic_pointer_cast<QRVCommandStageForDelete>(command);
    if (!stage) continue;
    EXPECT_EQ(stage->useLocking(), withLocking);
    for (const auto& id : stage->containerIdentities())
      out.push_back(id->identifier() + "/" + std::to_string(id->containerClass()) + "/" +
                    id->userIdentity()->identifier());
  }
  return out;
}

class QRVCodeSigningMappingTest : public QRVContainerTest {
 protected:
  QRVCodeSigningMappingTest() {
    // Three accessible users: the personal persona and two enterprise
    // personas, of which only "WORK" will have a user base directory.
    env_.personas->supported = true;
    env_.personas->list = {
        {1000, 501, 501, 0, "PERSONAL", "/private/var/mobile", {}, false, false},
        {1001, 501, 501, 1, "WORK", "/private/var/work", {}, false, false},
        {1002, 501, 501, 1, "GUEST", "/private/var/guest", {}, false, false},
    };
  }

  QRVCodeSigningMapping& mapping() { return *env_.services->codeSigningMapping; }
  std::string dbPath() { return env_.services->globalConfiguration->libraryDirectory() + "/containers.sqlite3"; }
  QRVUserIdentityRef personal() { return env_.services->userIdentityCache->userIdentityForPersonalPersona(); }
  QRVUserIdentityRef work() {
    return env_.services->userIdentityCache->userIdentityForPersonaUniqueString("WORK", 501, 501);
  }
  // Gives the personal and work users a user base directory (by making a
  // container for each) and leaves the guest without one.
  void prepareUsers() {
    create(identity("com.example.first", QRVContainerClassAppData, personal()));
    fs::create_directories(env_.root.path() + "/private/var/work/Containers");
  }

  uint64_t process(const std::string& id, const QRVPlist& i, QRVCommandQueue& q, const QRVPlist& options = {}) {
    return mapping().processCodeSigningInfo(i, id, options, q);
  }

  QRVCommandQueue queue_;
};

TEST_F(QRVCodeSigningMappingTest, IdenticalInformationWritesAndDeletesNothing) {
  QRVLogCapture log(env_.root.path());
  QRVPlist i = info(entitlements({"group.a"}, {"systemgroup.s"}, true));
  ASSERT_EQ(process("com.example.app", i, queue_, option(kQRVDataContainerClassOption, QRVPlist::uinteger(2))), 1u);
  EXPECT_THAT(log.text(), HasSubstr("Set Code Signing Mapping for ID: com.example.app"));

  QRVCommandQueue second;
  size_t mark = log.text().size();
  ASSERT_EQ(process("com.example.app", i, second, option(kQRVDataContainerClassOption, QRVPlist::uinteger(2))), 1u);
  EXPECT_EQ(second.pendingCount(), 0u);
  EXPECT_THAT(log.text().substr(mark), Not(HasSubstr("Set Code Signing Mapping")));
  EXPECT_THAT(log.text().substr(mark), Not(HasSubstr("Reconciled")));
  EXPECT_EQ(mapping().dataContainerTypeForIdentifier("com.example.app"), 2u);
  EXPECT_THAT(mapping().appGroupIdentifiersForIdentifier("com.example.app"), ElementsAre("group.a"));

  // A parent whose children are stored is identical too.
  ASSERT_EQ(process("com.example.app.plugin", info(entitlements({})), second,
                    option(kQRVParentBundleIDOption, QRVPlist::string("com.example.app"))),
            1u);
  mark = log.text().size();
  ASSERT_EQ(process("com.example.app", i, second, option(kQRVDataContainerClassOption, QRVPlist::uinteger(2))), 1u);
  EXPECT_THAT(log.text().substr(mark), Not(HasSubstr("Set Code Signing Mapping for ID: com.example.app :")));
  EXPECT_EQ(second.pendingCount(), 0u);
}

TEST_F(QRVCodeSigningMappingTest, TheLastClaimantStagesTheGroupForEveryUserWithABaseDirectory) {
  prepareUsers();
  QRVLogCapture log(env_.root.path());
  ASSERT_EQ(process("com.example.a", info(entitlements({"group.shared", "group.mine", "group.other"})), queue_), 1u);
  // Still claimed by a placeholder and by an invalidated entry.
  ASSERT_EQ(process("com.example.placeholder", info(entitlements({"group.shared"})), queue_,
                    option(kQRVPlaceholderOption, QRVPlist::boolean(true))),
            1u);
  ASSERT_EQ(process("com.example.stale", info(entitlements({"group.other"})), queue_), 1u);
  ASSERT_TRUE(mapping().invalidateCodeSigningInfoForIdentifier("com.example.stale", nullptr));
  EXPECT_EQ(queue_.pendingCount(), 0u);

  auto counts = mapping().copyReferenceCountSetOfType(QRVGroupTypeApplication);
  ASSERT_TRUE(counts);
  EXPECT_EQ((*counts)["group.shared"], 2);
  EXPECT_EQ((*counts)["group.mine"], 1);

  // Dropping the groups others still claim stages nothing.
  ASSERT_EQ(process("com.example.a", info(entitlements({"group.mine"})), queue_), 1u);
  EXPECT_THAT(staged(queue_), IsEmpty());
  EXPECT_THAT(log.text(), HasSubstr("ID: group.shared is 2"));
  EXPECT_THAT(log.text(), HasSubstr("ID: group.other is 2"));

  // Dropping the last claim stages it for the personal and work users only.
  QRVMetadataRef personalGroup = create(identity("group.mine", QRVContainerClassAppGroup, personal()));
  QRVMetadataRef workGroup = create(identity("group.mine", QRVContainerClassAppGroup, work()));
  ASSERT_EQ(mapping().removeCodeSigningDictionariesForIdentifierAndItsChildren("com.example.a", queue_), 1u);
  EXPECT_THAT(staged(queue_), UnorderedElementsAre("group.mine/7/" + personal()->identifier(), "group.mine/7/WORK"));
  EXPECT_FALSE(mapping().codeSigningEntryForIdentifier("com.example.a", nullptr));

  uint64_t result = 1;
  ASSERT_TRUE(queue_.executeAllUntilExhaustedOrError(&result)) << result;
  QRVError error;
  EXPECT_EQ(lookup(identity("group.mine", QRVContainerClassAppGroup, personal()), &error), nullptr);
  EXPECT_EQ(lookup(identity("group.mine", QRVContainerClassAppGroup, work()), &error), nullptr);
  EXPECT_FALSE(fs::exists(personalGroup->url()));
  // The placeholder's group survives it all.
  EXPECT_THAT(mapping().appGroupIdentifiersForIdentifier("com.example.placeholder"), ElementsAre("group.shared"));
}

TEST_F(QRVCodeSigningMappingTest, SystemClaimsSystemGroupsAndThePrefixRule) {
  QRVLogCapture log(env_.root.path());
  QRVPlist e = entitlements({"noprefix.group"}, {"systemgroup.kept", "noprefix.group"}, true);
  ASSERT_EQ(process("com.example.daemon", info(e), queue_), 1u);
  EXPECT_THAT(mapping().systemGroupIdentifiersForIdentifier("com.example.daemon"), ElementsAre("systemgroup.kept"));
  EXPECT_THAT(mapping().appGroupIdentifiersForIdentifier("com.example.daemon"), ElementsAre("noprefix.group"));
  EXPECT_THAT(log.text(), HasSubstr("System group ID noprefix.group does not have proper prefix, ignoring."));
  EXPECT_TRUE(mapping().identifierHasSystemContainer("com.example.daemon"));

  // The older key stands in when the newer one is absent.
  QRVPlist older = QRVPlist::dictionary();
  older.set(kQRVSystemGroupContainersEntitlement, QRVPlist::string("systemgroup.old"));
  ASSERT_EQ(process("com.example.older", info(older), queue_), 1u);
  EXPECT_THAT(mapping().systemGroupIdentifiersForIdentifier("com.example.older"), ElementsAre("systemgroup.old"));

  // Dropping the system group and the system container: only the system
  // container is staged, never the system group.
  ASSERT_EQ(process("com.example.daemon", info(entitlements({"noprefix.group"})), queue_), 1u);
  EXPECT_THAT(staged(queue_), ElementsAre("com.example.daemon/12/" +
                                          env_.services->userIdentityCache->defaultUserIdentity()->identifier()));
  EXPECT_THAT(log.text(), HasSubstr("Would have removed system group container references for (systemgroup.kept)"));
  EXPECT_THAT(log.text(), HasSubstr("Deleting system container for ID: com.example.daemon because it is no longer"));
  EXPECT_FALSE(mapping().identifierHasSystemContainer("com.example.daemon"));
}

TEST_F(QRVCodeSigningMappingTest, ParentsAndChildren) {
  ASSERT_EQ(process("com.example.host", info(entitlements({})), queue_), 1u);
  for (int i = 0; i < 2; i++) {
    ASSERT_EQ(process("com.example.host.ext", info(entitlements({"group.ext"})), queue_,
                      option(kQRVParentBundleIDOption, QRVPlist::string("com.example.host"))),
              1u);
  }
  EXPECT_THAT(*mapping().childBundleIdentifiersForParentIdentifier("com.example.host"),
              ElementsAre("com.example.host.ext"));
  EXPECT_EQ(mapping().parentIdentifierForChildIdentifier("com.example.host.ext"), "com.example.host");
  // Re-processing the parent keeps its children.
  ASSERT_EQ(process("com.example.host", info(entitlements({"group.host"})), queue_), 1u);
  EXPECT_EQ(mapping().parentIdentifierForChildIdentifier("com.example.host.ext"), "com.example.host");

  // Refused: its own parent, or a parent that is its own descendant.
  EXPECT_EQ(process("com.example.host", info(entitlements({})), queue_,
                    option(kQRVParentBundleIDOption, QRVPlist::string("com.example.host"))),
            11u);
  EXPECT_EQ(process("com.example.host", info(entitlements({})), queue_,
                    option(kQRVParentBundleIDOption, QRVPlist::string("com.example.host.ext"))),
            11u);
  EXPECT_FALSE(mapping().parentIdentifierForChildIdentifier("com.example.host"));
  EXPECT_THAT(mapping().appGroupIdentifiersForIdentifier("com.example.host"), ElementsAre("group.host"));

  // Removing the parent removes the child with it.
  ASSERT_EQ(mapping().removeCodeSigningDictionariesForIdentifierAndItsChildren("com.example.host", queue_), 1u);
  EXPECT_FALSE(mapping().codeSigningEntryForIdentifier("com.example.host", nullptr));
  EXPECT_FALSE(mapping().codeSigningEntryForIdentifier("com.example.host.ext", nullptr));
  EXPECT_THAT(*mapping().identifiersWithError(nullptr), IsEmpty());
}

TEST_F(QRVCodeSigningMappingTest, CallerRegistrationNeverOverwritesInstallerInformation) {
  QRVPlist installed = entitlements({"group.installed"});
  ASSERT_EQ(process("com.example.installed", info(installed), queue_), 1u);
  EXPECT_EQ(
      mapping().processCallerRegisteredEntitlements(entitlements({"group.caller"}), "com.example.installed", queue_),
      1u);
  EXPECT_EQ(mapping().entitlementsForIdentifier("com.example.installed"), installed);
  EXPECT_FALSE(mapping().identifierHasCallerRegisteredEntitlements("com.example.installed"));

  ASSERT_EQ(mapping().processCallerRegisteredEntitlements(entitlements({"group.one"}), "com.example.tool", queue_), 1u);
  EXPECT_TRUE(mapping().identifierHasCallerRegisteredEntitlements("com.example.tool"));
  ASSERT_EQ(mapping().processCallerRegisteredEntitlements(entitlements({"group.two"}), "com.example.tool", queue_), 1u);
  EXPECT_THAT(mapping().appGroupIdentifiersForIdentifier("com.example.tool"), ElementsAre("group.two"));
  // The installer's information replaces a caller's registration.
  ASSERT_EQ(process("com.example.tool", info(installed), queue_), 1u);
  EXPECT_FALSE(mapping().identifierHasCallerRegisteredEntitlements("com.example.tool"));
  EXPECT_EQ(mapping().processCallerRegisteredEntitlements(QRVPlist(), "com.example.tool", queue_), 18u);
  EXPECT_EQ(mapping().processCallerRegisteredEntitlements(entitlements({}), std::nullopt, queue_), 18u);
}

TEST_F(QRVCodeSigningMappingTest, BundleContainerCopyIsMigratedOnDemand) {
  QRVLogCapture log(env_.root.path());
  auto bundle = identity("com.example.old", QRVContainerClassAppBundle);
  create(bundle);
  QRVPlist cached = QRVPlist::dictionary();
  cached.set("Entitlements", entitlements({"group.old"}));
  QRVError error;
  ASSERT_TRUE(admin()->setInfoValue(cached, QRVPlist::string("com.kelva.Verdane.CachedCodeSigningInfo"), bundle,
                                    /*useLocking=*/true, &error))
      << error.description();

  EXPECT_EQ(mapping().entitlementsForIdentifier("com.example.old"), entitlements({"group.old"}));
  EXPECT_THAT(log.text(),
              HasSubstr("Migrating code signing info from bundle container upon request for com.example.old"));
  auto entry = mapping().codeSigningEntryForIdentifier("com.example.old", nullptr);
  ASSERT_TRUE(entry);
  EXPECT_EQ(entry->dataContainerClass(), 2u);
  EXPECT_EQ(*entry->codeSigningInfo().get(kQRVCodeSigningEntitlementsKey), entitlements({"group.old"}));
}

TEST_F(QRVCodeSigningMappingTest, OrphansAreInvalidatedAndHiddenFromExternalRequesters) {
  create(identity("com.example.present", QRVContainerClassAppBundle));
  ASSERT_EQ(process("com.example.present", info(entitlements({})), queue_), 1u);
  ASSERT_EQ(process("com.example.gone", info(entitlements({"group.gone"})), queue_), 1u);
  ASSERT_EQ(mapping().processCallerRegisteredEntitlements(entitlements({}), "com.example.registered", queue_), 1u);
  ASSERT_EQ(process("com.example.gone.ext", info(entitlements({})), queue_,
                    option(kQRVParentBundleIDOption, QRVPlist::string("com.example.gone"))),
            1u);
  ASSERT_EQ(process("com.example.loose.ext", info(entitlements({})), queue_,
                    option(kQRVDataContainerClassOption, QRVPlist::uinteger(4))),
            1u);

  EXPECT_EQ(mapping().invalidateCodeSigningInfoForAppsWithoutBundleContainer(), 1u);
  auto invalid = [&](const std::string& id) {
    return mapping().codeSigningEntryForIdentifier(id, nullptr)->isInvalid();
  };
  EXPECT_FALSE(invalid("com.example.present"));
  EXPECT_FALSE(invalid("com.example.registered"));
  EXPECT_TRUE(invalid("com.example.gone"));
  EXPECT_TRUE(invalid("com.example.gone.ext"));  // with its parent
  EXPECT_TRUE(invalid("com.example.loose.ext"));
  // Invalid entries still claim their groups but are not shown outside.
  EXPECT_FALSE(mapping().getCodeSigningInfoForIdentifier("com.example.gone"));
  EXPECT_TRUE(mapping().getCodeSigningInfoForIdentifier("com.example.present"));
  EXPECT_THAT(mapping().appGroupIdentifiersForIdentifier("com.example.gone"), ElementsAre("group.gone"));
  EXPECT_EQ(queue_.pendingCount(), 0u);
}

TEST_F(QRVCodeSigningMappingTest, AnUnusableDatabaseNeitherStopsTheDaemonNorLosesData) {
  QRVLogCapture log(env_.root.path());
  // Garbage where the database should be.
  {
    std::ofstream out(dbPath(), std::ios::binary);
    out << std::string(8192, '\x5a');
  }
  EXPECT_FALSE(mapping().entitlementsForIdentifier("com.example.app"));
  EXPECT_EQ(process("com.example.app", info(entitlements({"group.a"})), queue_), 66u);
  EXPECT_FALSE(mapping().copyReferenceCountSetOfType(QRVGroupTypeApplication));
  EXPECT_EQ(mapping().parentIdentifierForChildIdentifier("com.example.ext"), std::nullopt);
  EXPECT_THAT(*mapping().identifiersWithError(nullptr), IsEmpty());
  EXPECT_THAT(log.text(), HasSubstr("Failed to initialize database."));
  // Containers are still served, and nothing is reconciled away.
  create(identity("com.example.daemon", QRVContainerClassSystemData));
  create(identity("com.example.app.ext", QRVContainerClassPluginData));
  mapping().performAllCodeSigningMigrationAndReconciliationWithCommandQueue(queue_);
  EXPECT_EQ(queue_.pendingCount(), 0u);

  // Repaired: the next use opens it.
  fs::remove(dbPath());
  EXPECT_EQ(process("com.example.app", info(entitlements({"group.a"})), queue_), 1u);
  EXPECT_THAT(mapping().appGroupIdentifiersForIdentifier("com.example.app"), ElementsAre("group.a"));
}

TEST_F(QRVCodeSigningMappingTest, ADatabaseHeldByAnotherProcessIsRetriedLater) {
  QRVLogCapture log(env_.root.path());
  sqlite3* other = QRVSQLiteSchema::tryOpenDBWithURL(dbPath(), nullptr);
  ASSERT_NE(other, nullptr);
  // The exclusive lock is taken by the first access and then kept.
  ASSERT_EQ(sqlite3_exec(other, "SELECT count(*) FROM code_signing_info;", nullptr, nullptr, nullptr), SQLITE_OK);

  EXPECT_EQ(process("com.example.app", info(entitlements({"group.a"})), queue_), 66u);
  EXPECT_FALSE(mapping().codeSigningEntryForIdentifier("com.example.app", nullptr));
  EXPECT_THAT(log.text(), HasSubstr("Failed to initialize database."));
  QRVError error;
  EXPECT_FALSE(mapping().removeAllAdvanceCopiesWithError(&error));
  EXPECT_EQ(error.code(), 66u);

  sqlite3_close(other);
  EXPECT_EQ(process("com.example.app", info(entitlements({"group.a"})), queue_), 1u);
  EXPECT_THAT(mapping().appGroupIdentifiersForIdentifier("com.example.app"), ElementsAre("group.a"));
}

TEST_F(QRVCodeSigningMappingTest, MalformedInputIsRefusedOrIgnoredWithoutLosingAnything) {
  QRVLogCapture log(env_.root.path());
  ASSERT_EQ(process("com.example.app", info(entitlements({"group.a"}, {}, true)), queue_), 1u);

  // Information that is there but not a dictionary is refused, not taken for
  // a removal.
  EXPECT_EQ(process("com.example.app", QRVPlist::string("oops"), queue_), 11u);
  EXPECT_EQ(process("com.example.app", stringArray({"a"}), queue_), 11u);
  EXPECT_EQ(mapping().processCodeSigningInfo(info(entitlements({})), std::nullopt, QRVPlist(), queue_), 18u);
  EXPECT_THAT(mapping().appGroupIdentifiersForIdentifier("com.example.app"), ElementsAre("group.a"));
  EXPECT_EQ(queue_.pendingCount(), 0u);

  // Mistyped options are ignored one by one.
  QRVPlist options = QRVPlist::dictionary();
  options.set(kQRVDataContainerClassOption, QRVPlist::string("2"));
  options.set(kQRVParentBundleIDOption, QRVPlist::uinteger(7));
  options.set(kQRVPlaceholderOption, QRVPlist::string("yes"));
  options.set(kQRVAdvanceCopyOption, QRVPlist::boolean(true));
  ASSERT_EQ(process("com.example.typed", info(entitlements({})), queue_, options), 1u);
  auto entry = mapping().codeSigningEntryForIdentifier("com.example.typed", nullptr);
  ASSERT_TRUE(entry);
  EXPECT_EQ(entry->dataContainerClass(), 0u);
  EXPECT_FALSE(entry->isPlaceholder());
  EXPECT_TRUE(entry->isAdvanceCopy());
  EXPECT_FALSE(mapping().parentIdentifierForChildIdentifier("com.example.typed"));
  EXPECT_THAT(log.text(), HasSubstr("is not a boolean; ignoring"));
  EXPECT_EQ(process("com.example.opts", info(entitlements({})), queue_, QRVPlist::string("x")), 1u);

  // Group entitlements of the wrong types claim nothing.
  QRVPlist mixed = QRVPlist::dictionary();
  QRVPlist array = stringArray({"group.fine"});
  array.append(QRVPlist::uinteger(3));
  mixed.set(kQRVApplicationGroupsEntitlement, array);
  mixed.set(kQRVSystemGroupsEntitlement, QRVPlist::uinteger(5));
  mixed.set(kQRVSystemContainerEntitlement, QRVPlist::string("true"));
  ASSERT_EQ(process("com.example.mixed", info(mixed), queue_), 1u);
  EXPECT_THAT(mapping().appGroupIdentifiersForIdentifier("com.example.mixed"), IsEmpty());
  EXPECT_THAT(mapping().systemGroupIdentifiersForIdentifier("com.example.mixed"), IsEmpty());
  EXPECT_FALSE(mapping().identifierHasSystemContainer("com.example.mixed"));
  EXPECT_THAT(log.text(), HasSubstr("contains non-string values; ignoring."));
  EXPECT_THAT(log.text(), HasSubstr("does not contain supported types; ignoring."));
  auto counts = mapping().copyReferenceCountSetOfType(QRVGroupTypeApplication);
  ASSERT_TRUE(counts);
  EXPECT_EQ(counts->count("group.fine"), 0u);

  // Identifiers are bytes: quotes, NULs and invalid UTF-8 are kept apart.
  const std::string odd[] = {"com.\"quoted'.app", std::string("nul\0inside", 10), "bad\xff\xfe.utf8",
                             std::string("nul\0other", 9)};
  for (const auto& id : odd)
    ASSERT_EQ(process(id, info(entitlements({"group." + std::to_string(id.size())})), queue_), 1u);
  for (const auto& id : odd)
    EXPECT_THAT(mapping().appGroupIdentifiersForIdentifier(id), ElementsAre("group." + std::to_string(id.size())));
  EXPECT_FALSE(mapping().codeSigningEntryForIdentifier("nul", nullptr));
  EXPECT_THAT(mapping().appGroupIdentifiersForIdentifier("com.example.app"), ElementsAre("group.a"));
}

TEST_F(QRVCodeSigningMappingTest, CacheLookupsOfPluginsDoNotDeadlockWithProcessing) {
  ASSERT_EQ(process("com.example.host", info(entitlements({})), queue_), 1u);
  for (int i = 0; i < 4; i++) {
    std::string id = "com.example.host.ext" + std::to_string(i);
    ASSERT_EQ(process(id, info(entitlements({})), queue_,
                      option(kQRVParentBundleIDOption, QRVPlist::string("com.example.host"))),
              1u);
    create(identity(id, QRVContainerClassPluginData, personal()));
  }
  std::atomic<bool> stop{false};
  auto lookups = std::async(std::launch::async, [&] {
    int n = 0;
    while (!stop) {
      // A fresh cache pushes each plug-in to the sandbox, asking for its
      // parent while the cache lock is held.
      auto cache = std::make_shared<QRVContainerCache>(env_.services->fileManager, env_.services->globalConfiguration,
                                                       env_.services->userIdentityCache,
                                                       env_.services->platform.sandbox, env_.services->pluginParents);
      auto all = cache->allContainersForUserIdentity(personal(), QRVContainerClassPluginData, false,
                                                     /*populateSandboxCache=*/true, nullptr);
      EXPECT_TRUE(all);
      n++;
    }
    return n;
  });
  auto processing = std::async(std::launch::async, [&] {
    QRVCommandQueue q;
    for (int i = 0; i < 40; i++) {
      // The fallback look-up of a bundle container and the reference counts
      // both run while the other thread holds the cache lock.
      EXPECT_EQ(
          process("com.example.host.ext" + std::to_string(i % 4), info(entitlements({"group." + std::to_string(i)})), q,
                  option(kQRVParentBundleIDOption, QRVPlist::string("com.example.host"))),
          1u);
      EXPECT_FALSE(mapping().entitlementsForIdentifier("com.example.unknown" + std::to_string(i)));
    }
  });
  ASSERT_EQ(processing.wait_for(std::chrono::seconds(60)), std::future_status::ready) << "deadlock";
  stop = true;
  ASSERT_EQ(lookups.wait_for(std::chrono::seconds(60)), std::future_status::ready) << "deadlock";
  EXPECT_GT(lookups.get(), 0);
}

TEST_F(QRVCodeSigningMappingTest, BootMigratesTheLegacyFileAndRemovesUnclaimedSystemContainers) {
  // A mapping file of an older release, read when the database first opens.
  QRVPlist legacy = QRVPlist::dictionary();
  QRVCodeSigningEntry old(info(entitlements({}, {}, true)), 2);
  legacy.set("com.example.legacy", old.serialize());
  legacy.set("com.example.broken", QRVPlist::string("not an entry"));
  const std::string file = env_.services->globalConfiguration->libraryDirectory() + "/qrv_code_signing_info.plist";
  auto bytes = legacy.toBinary();
  std::ofstream(file, std::ios::binary).write(reinterpret_cast<const char*>(bytes.data()), bytes.size());

  EXPECT_TRUE(mapping().identifierHasSystemContainer("com.example.legacy"));
  EXPECT_FALSE(fs::exists(file));

  create(identity("com.example.legacy", QRVContainerClassSystemData));
  create(identity("com.example.unclaimed", QRVContainerClassSystemData));
  mapping().performAllCodeSigningMigrationAndReconciliationWithCommandQueue(queue_);
  EXPECT_THAT(staged(queue_), ElementsAre("com.example.unclaimed/12/" +
                                          env_.services->userIdentityCache->defaultUserIdentity()->identifier()));
}

TEST_F(QRVCodeSigningMappingTest, BootCarriesOlderMetadataIntoTheDatabaseOnceAndSweepsGroups) {
  prepareUsers();
  QRVError error;
  // Group identifiers an older release kept in a data container, and the
  // code-signing information it cached in a bundle container.
  auto data = identity("com.example.olddata", QRVContainerClassAppData, personal());
  create(data);
  ASSERT_TRUE(admin()->setInfoValue(stringArray({"group.legacy"}),
                                    QRVPlist::string("com.kelva.Verdane.GroupContainerIDs"), data, true, &error))
      << error.description();
  auto bundle = identity("com.example.cached", QRVContainerClassAppBundle);
  create(bundle);
  QRVPlist cached = QRVPlist::dictionary();
  cached.set("Entitlements", entitlements({"group.cached"}));
  ASSERT_TRUE(
      admin()->setInfoValue(cached, QRVPlist::string("com.kelva.Verdane.CachedCodeSigningInfo"), bundle, true, &error));
  for (const char* group : {"group.legacy", "group.cached", "group.orphan"})
    create(identity(group, QRVContainerClassAppGroup, personal()));

  mapping().performAllCodeSigningMigrationAndReconciliationWithCommandQueue(queue_);
  EXPECT_THAT(staged(queue_, /*withLocking=*/false), ElementsAre("group.orphan/7/" + personal()->identifier()));
  auto legacy = mapping().codeSigningEntryForIdentifier("com.example.olddata", nullptr);
  ASSERT_TRUE(legacy);
  EXPECT_TRUE(legacy->isPlaceholder());
  EXPECT_THAT(mapping().appGroupIdentifiersForIdentifier("com.example.olddata"), ElementsAre("group.legacy"));
  EXPECT_THAT(mapping().appGroupIdentifiersForIdentifier("com.example.cached"), ElementsAre("group.cached"));
  EXPECT_FALSE(admin()->infoValueForKey(QRVPlist::string("com.kelva.Verdane.GroupContainerIDs"), data, true, nullptr));
  EXPECT_FALSE(
      admin()->infoValueForKey(QRVPlist::string("com.kelva.Verdane.CachedCodeSigningInfo"), bundle, true, nullptr));
  auto status = QRVMigrationStatus::initForSystemMigration(*env_.services);
  ASSERT_TRUE(status);
  EXPECT_TRUE(status->hasMigrationOccurredForType(QRVMigrationStatus::kGroupIdMigration));
  EXPECT_TRUE(status->hasMigrationOccurredForType(QRVMigrationStatus::kCodeSigningMigration));

  // A multi-user host sweeps no application groups.
  env_.personas->flags = QRVPersonaService::kMultiUserHostBit;
  QRVCommandQueue second;
  mapping().performAllCodeSigningMigrationAndReconciliationWithCommandQueue(second);
  EXPECT_EQ(second.pendingCount(), 0u);
}

}  // namespace

namespace {

// The kept counts after a long run of mixed changes must be what a walk of
// the database finds, for both group types: a count that drifts would let a
// group's container be deleted while it is still claimed, or kept forever.
TEST_F(QRVCodeSigningMappingTest, KeptCountsAlwaysEqualAFreshWalk) {
  std::mt19937 random(20261123);
  auto pick = [&](int n) { return static_cast<int>(random() % static_cast<unsigned>(n)); };
  auto groups = [&](const char* prefix, int max) {
    Strings out;
    for (int k = pick(max + 1); k > 0; k--) out.push_back(prefix + std::to_string(pick(6)));
    return out;
  };
  auto compare = [&](int step) {
    auto kept = std::make_pair(mapping().copyReferenceCountSetOfType(QRVGroupTypeApplication),
                               mapping().copyReferenceCountSetOfType(QRVGroupTypeSystem));
    mapping().TEST_forgetReferenceCounts();
    auto walked = std::make_pair(mapping().copyReferenceCountSetOfType(QRVGroupTypeApplication),
                                 mapping().copyReferenceCountSetOfType(QRVGroupTypeSystem));
    ASSERT_TRUE(kept.first && kept.second && walked.first && walked.second);
    EXPECT_EQ(*kept.first, *walked.first) << "application groups after step " << step;
    EXPECT_EQ(*kept.second, *walked.second) << "system groups after step " << step;
  };
  compare(-1);  // builds the counts, which every change below must keep up
  for (int step = 0; step < 300; step++) {
    QRVCommandQueue queue;
    const std::string id = "com.example.app" + std::to_string(pick(12));
    switch (pick(6)) {
      case 0:  // removed, with its children
        mapping().removeCodeSigningDictionariesForIdentifierAndItsChildren(id, queue);
        break;
      case 1: {  // one string instead of an array, and a malformed list
        QRVPlist e = QRVPlist::dictionary();
        e.set(kQRVApplicationGroupsEntitlement, QRVPlist::string("group.one" + std::to_string(pick(3))));
        if (pick(2)) e.set(kQRVSystemGroupsEntitlement, QRVPlist::uinteger(7));
        mapping().processCodeSigningInfo(info(e), id, QRVPlist(), queue);
        break;
      }
      case 2:  // a caller's registration
        mapping().processCallerRegisteredEntitlements(entitlements(groups("group.reg", 2)), id, queue);
        break;
      case 3:  // a placeholder or advance copy, later swept
        mapping().processCodeSigningInfo(
            info(entitlements(groups("group.", 3))), id,
            option(pick(2) ? kQRVPlaceholderOption : kQRVAdvanceCopyOption, QRVPlist::boolean(true)), queue);
        if (pick(4) == 0) {
          ASSERT_TRUE(mapping().removeAllAdvanceCopiesWithError(nullptr));
        }
        break;
      case 4:  // a plug-in of another application
        mapping().processCodeSigningInfo(info(entitlements(groups("group.", 2))), id + ".plugin",
                                         option(kQRVParentBundleIDOption, QRVPlist::string(id)), queue);
        break;
      default:  // installed or updated, with system groups and a fallback key
        QRVPlist e = entitlements(groups("group.", 4), groups("systemgroup.s", 2));
        if (pick(3) == 0) e.set(kQRVSystemGroupContainersEntitlement, stringArray({"systemgroup.fallback"}));
        mapping().processCodeSigningInfo(info(e), id, QRVPlist(), queue);
        break;
    }
    if (step % 25 == 0) compare(step);
  }
  compare(300);
}

}  // namespace

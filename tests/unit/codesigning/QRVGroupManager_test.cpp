// Group containers against a real code-signing database on a temporary root:
// who may have an owner's groups, creation on demand, and the sweep of
// containers nobody claims any more.
#include "codesigning/QRVGroupManager.h"

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include "base/QRVLog.h"
#include "codesigning/QRVCodeSigningMapping.h"
#include "support/QRVContainerTest.h"

namespace {

namespace fs = std::filesystem;

QRVPlist strings(std::initializer_list<const char*> values) {
  QRVPlist array = QRVPlist::array();
  for (const char* v : values) array.append(QRVPlist::string(v));
  return array;
}

// Code-signing information whose entitlements claim these groups.
QRVPlist claiming(QRVPlist applicationGroups, QRVPlist systemGroups = QRVPlist::array()) {
  QRVPlist entitlements = QRVPlist::dictionary()
                              .set(kQRVApplicationGroupsEntitlement, std::move(applicationGroups))
                              .set(kQRVSystemGroupsEntitlement, std::move(systemGroups));
  return QRVPlist::dictionary().set(kQRVCodeSigningEntitlementsKey, std::move(entitlements));
}

class GroupManagerTest : public QRVContainerTest {
 protected:
  GroupManagerTest() { startMapping(); }
  ~GroupManagerTest() override { QRVLog::close(); }

  // The daemon's mapping, as after a start: a fresh object on the database
  // file the previous one left.
  void startMapping() {
    env_.services->codeSigningMapping = std::make_shared<QRVCodeSigningMapping>(env_.services);
    env_.services->codeSigning = env_.services->codeSigningMapping;
    env_.services->systemGroups = env_.services->codeSigningMapping;
  }
  // The daemon going down: the mapping closes the database.
  void stopMapping() {
    env_.services->codeSigning = std::make_shared<QRVNoCodeSigningQueries>();
    env_.services->systemGroups = std::make_shared<QRVNoSystemGroupQueries>();
    env_.services->codeSigningMapping.reset();
  }
  QRVCodeSigningMapping& mapping() { return *env_.services->codeSigningMapping; }
  QRVGroupManager& groups() { return *env_.services->groupManager; }

  void install(const std::string& identifier, const QRVPlist& info, const QRVPlist& options = QRVPlist()) {
    QRVCommandQueue queue;
    ASSERT_EQ(mapping().processCodeSigningInfo(info, identifier, options, queue), 1u);
    uint64_t result = 1;
    ASSERT_TRUE(queue.executeAllUntilExhaustedOrError(&result)) << result;
  }

  // Removes entries behind the daemon's back, as if their applications had
  // been removed while it was not running.
  void deleteEntriesDirectly(std::initializer_list<const char*> identifiers) {
    stopMapping();
    std::string path = env_.services->globalConfiguration->libraryDirectory() + "/containers.sqlite3";
    ASSERT_TRUE(fs::exists(path)) << path;
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open(path.c_str(), &db), SQLITE_OK);
    ASSERT_EQ(sqlite3_exec(db, "PRAGMA foreign_keys = ON;", nullptr, nullptr, nullptr), SQLITE_OK);
    for (const char* identifier : identifiers) {
      std::string sql = std::string("DELETE FROM code_signing_info WHERE code_signing_id_text='") + identifier + "';";
      ASSERT_EQ(sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK) << sqlite3_errmsg(db);
      EXPECT_EQ(sqlite3_changes(db), 1) << identifier;
    }
    sqlite3_close(db);
    startMapping();
  }

  // Runs the sweep of `type` and drains what it queued.
  void sweep(QRVGroupType type) {
    QRVCommandQueue queue;
    groups().reconcileGroupContainersOfType(type, queue);
    uint64_t result = 1;
    EXPECT_TRUE(queue.executeAllUntilExhaustedOrError(&result)) << result;
  }

  std::string startLog() {
    std::string path = env_.root.path() + "/groups.log";
    QRVLog::open("com.kelva.quorvad", path, QRVLogLevel::kNotice, 1, 1 << 20);
    return path;
  }
  static std::string readLog(const std::string& path) {
    QRVLog::close();
    std::stringstream text;
    text << std::ifstream(path).rdbuf();
    return text.str();
  }

  std::optional<std::map<std::string, QRVMetadataRef>> groupsOf(QRVClientConnection& caller, const std::string& owner,
                                                                QRVContainerClass c, QRVError* error,
                                                                QRVUserIdentityRef user = nullptr) {
    if (!user)
      user = c == QRVContainerClassSystemGroup ? env_.services->userIdentityCache->defaultUserIdentity() : mobile();
    return caller.groupContainersForOwnerIdentifier(owner, user, c, error);
  }
};

TEST_F(GroupManagerTest, OwnersGetTheirClaimedGroupsAndNobodyElseDoesWithoutARight) {
  install("com.example.mail", claiming(strings({"group.shared", "group.mail"}), strings({"systemgroup.example"})));
  install("com.example.notes", claiming(strings({"group.shared"})));
  install("com.example.plain", QRVPlist::dictionary().set(kQRVCodeSigningEntitlementsKey, QRVPlist::dictionary()));

  // The claims, by class.
  QRVError error;
  auto appGroups = groups().groupContainerIdentifiersForOwnerIdentifier("com.example.mail", QRVContainerClassAppGroup,
                                                                        /*useLocking=*/true, &error);
  ASSERT_TRUE(appGroups);
  EXPECT_EQ(std::set<std::string>(appGroups->begin(), appGroups->end()),
            (std::set<std::string>{"group.shared", "group.mail"}));
  auto systemGroups = groups().groupContainerIdentifiersForOwnerIdentifier(
      "com.example.mail", QRVContainerClassSystemGroup, /*useLocking=*/true, &error);
  ASSERT_TRUE(systemGroups);
  EXPECT_EQ(*systemGroups, std::vector<std::string>{"systemgroup.example"});
  EXPECT_FALSE(
      groups().groupContainerIdentifiersForOwnerIdentifier(std::nullopt, QRVContainerClassAppGroup, true, &error));
  EXPECT_EQ(error.resultCode(), 11u);

  // An owner without group entitlements, or unknown altogether, gets an
  // empty map, not an error.
  for (const char* owner : {"com.example.plain", "com.example.unknown"}) {
    auto none = groupsOf(*connectionFor(owner), owner, QRVContainerClassAppGroup, &error);
    ASSERT_TRUE(none) << owner << ": " << error.description();
    EXPECT_TRUE(none->empty()) << owner;
  }

  // The two claimants of a group get the same container, made on the first
  // request.
  auto mail = groupsOf(*connectionFor("com.example.mail"), "com.example.mail", QRVContainerClassAppGroup, &error);
  ASSERT_TRUE(mail) << error.description();
  ASSERT_EQ(mail->size(), 2u);
  EXPECT_FALSE(mail->at("group.shared")->existed());
  auto notes = groupsOf(*connectionFor("com.example.notes"), "com.example.notes", QRVContainerClassAppGroup, &error);
  ASSERT_TRUE(notes) << error.description();
  ASSERT_EQ(notes->size(), 1u);
  EXPECT_EQ(notes->at("group.shared")->url(), mail->at("group.shared")->url());
  EXPECT_TRUE(notes->at("group.shared")->existed());
  EXPECT_TRUE(fs::is_directory(mail->at("group.mail")->url() + "/Library/Caches"));
  // System groups live with the default user.
  auto system = groupsOf(*connectionFor("com.example.mail"), "com.example.mail", QRVContainerClassSystemGroup, &error);
  ASSERT_TRUE(system) << error.description();
  ASSERT_EQ(system->size(), 1u);
  EXPECT_EQ(system->at("systemgroup.example")->containerClass(), QRVContainerClassSystemGroup);

  // Another owner's groups: refused with 55 and a line that names the
  // caller, the class and the owner; nothing is created for the intruder.
  const std::string log = startLog();
  auto intruder = connectionFor("com.example.intruder");
  EXPECT_FALSE(groupsOf(*intruder, "com.example.mail", QRVContainerClassAppGroup, &error));
  EXPECT_EQ(error.resultCode(), 55u);
  EXPECT_FALSE(intruder->allowGroupIdLookup());
  // A lookup entitlement for another class or owner grants nothing here.
  QRVPlist otherClass = QRVPlist::dictionary().set("appData", strings({"com.example.mail"}));
  QRVPlist otherOwner = QRVPlist::dictionary().set("appGroup", strings({"com.example.notes"}));
  for (const QRVPlist& lookup : {otherClass, otherOwner}) {
    EXPECT_FALSE(groupsOf(*connectionFor("com.example.intruder", {.lookup = lookup}), "com.example.mail",
                          QRVContainerClassAppGroup, &error));
    EXPECT_EQ(error.resultCode(), 55u);
  }
  EXPECT_NE(readLog(log).find("com.example.intruder not entitled to retrieve group container class 7 with "
                              "identifier com.example.mail"),
            std::string::npos);

  // Each of the other rights is enough on its own.
  QRVPlist granted = QRVPlist::dictionary().set("appGroup", strings({"com.example.mail"}));
  for (QRVTestCallerPowers powers :
       {QRVTestCallerPowers{.allowOtherIdLookup = true}, QRVTestCallerPowers{.unrestricted = true},
        QRVTestCallerPowers{.lookup = granted}}) {
    auto found =
        groupsOf(*connectionFor("com.example.helper", powers), "com.example.mail", QRVContainerClassAppGroup, &error);
    ASSERT_TRUE(found) << error.description();
    EXPECT_EQ(found->at("group.mail")->url(), mail->at("group.mail")->url());
  }
}

TEST_F(GroupManagerTest, AGroupThatCannotBeCreatedIsLeftOutAndTheOthersAreHandedOut) {
  install("com.example.mail", claiming(strings({"group.a", "group.b"})));
  // An unrelated group first, so that the user's class and staging
  // directories exist and the next directory made is a group's own.
  create(identity("group.unrelated", QRVContainerClassAppGroup));

  const std::string log = startLog();
  env_.posixFileSystem->failNext(QRVFaultInjectionFileSystem::Operation::kMakeDirectory, EIO, "/Staging/");
  QRVError error;
  auto caller = connectionFor("com.example.mail");
  auto some = groupsOf(*caller, "com.example.mail", QRVContainerClassAppGroup, &error);
  ASSERT_TRUE(some) << error.description();
  EXPECT_EQ(some->size(), 1u);
  const std::string text = readLog(log);
  EXPECT_NE(text.find("Failed to create or lookup group container: group."), std::string::npos) << text;

  // Nothing of the failure lasts: the next request creates the missing one.
  auto all = groupsOf(*caller, "com.example.mail", QRVContainerClassAppGroup, &error);
  ASSERT_TRUE(all) << error.description();
  EXPECT_EQ(all->size(), 2u);
  for (const auto& [group, container] : *some) EXPECT_EQ(all->at(group)->url(), container->url());
}

TEST_F(GroupManagerTest, TheSweepRemovesGroupsWhoseClaimantsWentAwayWhileTheDaemonWasDown) {
  env_.personas->supported = true;
  env_.personas->list = {{1000, 501, 501, QRVPersonaTypePersonal, "PERSONAL", "/private/var/mobile", {}, false, false},
                         {1001, 501, 501, QRVPersonaTypeEnterprise, "WORK", "/private/var/work", {}, false, false},
                         {1002, 501, 501, QRVPersonaTypeEnterprise, "EMPTY", "/private/var/empty", {}, false, false}};
  for (const char* home : {"/private/var/work", "/private/var/empty"}) fs::create_directories(env_.root.path() + home);
  env_.services->userIdentityCache->flush();
  QRVUserIdentityRef personal = env_.services->userIdentityCache->userIdentityForPersonalPersona();
  QRVUserIdentityRef work = env_.services->userIdentityCache->userIdentityWithPersonaID(1001);
  ASSERT_TRUE(personal && work);

  install("com.example.gone", claiming(strings({"group.gone", "group.kept"})));
  install("com.example.stays", claiming(strings({"group.kept"})));
  // Claims that count although nobody may see their information.
  QRVPlist placeholder = QRVPlist::dictionary().set(kQRVPlaceholderOption, QRVPlist::boolean(true));
  install("com.example.placeholder", claiming(strings({"group.placeholder"})), placeholder);
  install("com.example.invalid", claiming(strings({"group.invalid"})));
  QRVError error;
  ASSERT_TRUE(mapping().invalidateCodeSigningInfoForIdentifier("com.example.invalid", &error)) << error.description();

  std::map<std::string, QRVMetadataRef> personalGroups, workGroups;
  for (const char* group : {"group.gone", "group.kept", "group.placeholder", "group.invalid"}) {
    personalGroups[group] = create(identity(group, QRVContainerClassAppGroup, personal));
    workGroups[group] = create(identity(group, QRVContainerClassAppGroup, work));
  }
  deleteEntriesDirectly({"com.example.gone"});

  const std::string log = startLog();
  sweep(QRVGroupTypeApplication);
  const std::string text = readLog(log);
  for (auto* containers : {&personalGroups, &workGroups}) {
    EXPECT_FALSE(fs::exists(containers->at("group.gone")->url()));
    EXPECT_FALSE(known(containers->at("group.gone")));
    for (const char* kept : {"group.kept", "group.placeholder", "group.invalid"}) {
      EXPECT_TRUE(fs::exists(containers->at(kept)->url())) << kept;
      EXPECT_TRUE(known(containers->at(kept))) << kept;
    }
  }
  EXPECT_NE(text.find("Removing group container group.gone for"), std::string::npos) << text;
  EXPECT_EQ(text.find("Removing group container group.kept"), std::string::npos) << text;
  // A user who never had containers is left alone: the sweep makes nothing.
  EXPECT_FALSE(fs::exists(env_.root.path() + "/private/var/empty/Containers"));
  // What went lies on death row.
  EXPECT_FALSE(fs::is_empty(env_.services->globalConfiguration->deathrowDirectory()));

  // Once its last claimant goes too, the shared group follows; the groups
  // of the placeholder and the invalid entry still stay.
  deleteEntriesDirectly({"com.example.stays"});
  sweep(QRVGroupTypeApplication);
  for (auto* containers : {&personalGroups, &workGroups}) {
    EXPECT_FALSE(fs::exists(containers->at("group.kept")->url()));
    EXPECT_TRUE(fs::exists(containers->at("group.placeholder")->url()));
    EXPECT_TRUE(fs::exists(containers->at("group.invalid")->url()));
  }
}

TEST_F(GroupManagerTest, SystemGroupsAreSweptForTheDefaultUserOnly) {
  install("com.example.daemon", claiming(QRVPlist::array(), strings({"systemgroup.kept"})));
  install("com.example.gone", claiming(QRVPlist::array(), strings({"systemgroup.gone"})));
  QRVMetadataRef kept = create(identity("systemgroup.kept", QRVContainerClassSystemGroup));
  QRVMetadataRef gone = create(identity("systemgroup.gone", QRVContainerClassSystemGroup));
  // An application group nobody claims is not the system sweep's business.
  QRVMetadataRef appGroup = create(identity("group.unclaimed", QRVContainerClassAppGroup));
  deleteEntriesDirectly({"com.example.gone"});

  sweep(QRVGroupTypeSystem);
  EXPECT_TRUE(fs::exists(kept->url()));
  EXPECT_FALSE(fs::exists(gone->url()));
  EXPECT_TRUE(fs::exists(appGroup->url()));

  // ... which the application sweep then removes.
  sweep(QRVGroupTypeApplication);
  EXPECT_FALSE(fs::exists(appGroup->url()));
  EXPECT_TRUE(fs::exists(kept->url()));
}

}  // namespace

// Every command of the daemon, sent to one running daemon by callers of each
// power, each from its own process: which callers are turned away, and which
// keys the reply of a caller that may run the command carries. The commands
// are rows of one table; a failing check names the command and the caller.
#include <gtest/gtest.h>
#include <unistd.h>

#include <functional>
#include <limits>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "client/QRVClient.h"
#include "integration/QRVDaemonProcess.h"
#include "integration/QRVRunAs.h"
#include "support/QRVFiles.h"
#include "support/QRVRequests.h"

namespace {

// The callers, from no power at all to the command's own right. A command
// whose right is "allowed" has no separate holder of its right.
enum Caller { kStranger, kPlain, kOtherIdLookup, kLookup, kAllowed, kRightHolder };
const char* const kCallerNames[] = {"a stranger",
                                    "a caller without rights",
                                    "an otherIdLookup holder",
                                    "a lookup-dictionary holder",
                                    "an \"allowed\" holder",
                                    "the holder of the command's right"};

// The callers a command turns away, each with the code it answers them.
using Refusals = std::map<Caller, uint64_t>;
Refusals refuse(std::initializer_list<Caller> callers, uint64_t code = 55) {
  Refusals refusals;
  for (Caller caller : callers) refusals[caller] = code;
  return refusals;
}
const Refusals kUnprivileged = refuse({kStranger, kPlain, kOtherIdLookup, kLookup});
const Refusals kAllButItsRight = refuse({kStranger, kPlain, kOtherIdLookup, kLookup, kAllowed});

constexpr uid_t kStrangerUID = 2400;  // not in the trust store
constexpr uid_t kPlainUID = 2401;
constexpr uid_t kOtherIdUID = 2402;
constexpr uid_t kLookupUID = 2403;
constexpr uid_t kAllowedUID = 2404;

constexpr const char* kPlainID = "com.example.catalogue.plain";
constexpr const char* kBundleID = "com.example.catalogue.bundle";  // class 1: one tree for every user
constexpr const char* kWipedID = "com.example.catalogue.wiped";    // the wipe right's holder, listed in it
constexpr const char* kCleanerID = "com.example.catalogue.cleaner";
constexpr const char* kAssetsID = "com.example.catalogue.assets";
constexpr const char* kStagerID = "com.example.catalogue.stager";
constexpr const char* kAppGroup = "group.example.catalogue";
constexpr const char* kSystemGroup = "systemgroup.com.example.catalogue";

// Holders of one right each (besides "allowed").
struct RightHolder {
  const char* right;
  uid_t uid;
  const char* identifier;
};
const RightHolder kRightHolders[] = {
    {"userManagedAssets", 2410, kAssetsID},
    {"wipeContainer", 2411, kWipedID},
    {"deleteContainerContent", 2412, kCleanerID},
    {"dataMigration", 2413, "com.example.catalogue.migrator"},
    {"testability", 2414, "com.example.catalogue.tester"},
    {"stageSharedContent", 2415, kStagerID},
};

QRVPlist str(const std::string& value) { return QRVPlist::string(value); }
QRVPlist num(uint64_t value) { return QRVPlist::uinteger(value); }

QRVPlist strings(std::initializer_list<const char*> values) {
  QRVPlist array = QRVPlist::array();
  for (const char* v : values) array.append(str(v));
  return array;
}

// What the running daemon told `uid` about `request`.
std::unique_ptr<QRVDaemonProcess> gDaemon;
QRVPlist ask(uid_t uid, const QRVPlist& request) { return QRVRepliesAs(*gDaemon, uid, {request})[0]; }
uint64_t code(const QRVPlist& reply) { return QRVClient::resultCode(reply); }

// The container of `identifier` as `uid` sees it, created when missing.
QRVPlist container(uid_t uid, const std::string& identifier, uint64_t containerClass, bool transient = false) {
  QRVPlist reply = ask(uid, QRVCreateRequest(identifier, containerClass, transient));
  EXPECT_EQ(code(reply), 1u) << "making " << identifier << " as " << uid << ": " << reply.description();
  return reply;
}

// A command on the bundle container `identifier`, named with its UUID.
QRVPlist onBundle(uint64_t command, const char* identifier = kBundleID) {
  return QRVRequest(command)
      .set("Identifier", str(identifier))
      .set("ContainerClass", num(1))
      .set("UUID", QRVPlist::data(container(kAllowedUID, identifier, 1).dataForKey("ReplyUUID")));
}

QRVPlist setInfoValue() { return onBundle(5).set("Key", str("k")).set("Value", str("v")); }

// The plain caller's code signing as the installer hands it over: it claims
// one application group.
void installPlainCaller() {
  QRVPlist claims = QRVPlist::dictionary().set("com.kelva.security.application-groups", strings({kAppGroup}));
  QRVPlist info = QRVPlist::dictionary().set("com.kelva.Quorva.Entitlements", claims);
  QRVPlist reply = ask(kAllowedUID, QRVRequest(18).set("Identifier", str(kPlainID)).set("CodeSigningInfo", info));
  EXPECT_EQ(code(reply), 1u) << reply.description();
}

QRVPlist groupsOfPlain(uint64_t command) {
  installPlainCaller();
  return QRVRequest(command).set("Identifier", str(kPlainID)).set("ContainerClass", num(7));
}

// Command 28 for the assets right holder's own application data container.
QRVPlist assetsPath() {
  return QRVRequest(28).set("Identifier", str(kAssetsID)).set("CreateIfNecessary", QRVPlist::boolean(true));
}

int gFreshName = 0;

struct Row {
  uint64_t command;
  const char* name;
  const char* right;                                     // the command's entitlement, after "com.kelva.private.Quorva."
  Refusals refused;                                      // every other caller succeeds
  std::set<std::string> replyKeys;                       // of a success, besides "ReplyError"
  std::function<QRVPlist(uid_t)> request;                // built anew for each caller, who is passed in
  std::function<void(const QRVPlist&)> check = nullptr;  // more about a successful reply
};

// clang-format off
const std::vector<Row>& rows() {
  static const std::vector<Row> kRows = {
    {0, "createOrLookupContainer", "allowed", refuse({kStranger}),
     {"ReplyUUID", "ReplyExisted", "ReplyPath", "ReplyIdentifier", "ReplyPersonaUniqueString", "SandboxToken"},
     [](uid_t) { return QRVCreateRequest(kPlainID, 2); }},
    {1, "containersWithClass", "allowed", refuse({kStranger, kPlain, kOtherIdLookup}),
     {"ReplyIdsArray", "ReplyUUIDsArray", "ReplyPersonaUniqueStringsArray"},
     [](uid_t) {
       container(kAllowedUID, kBundleID, 1);
       return QRVRequest(1).set("ContainerClass", num(1));
     },
     [](const QRVPlist& reply) {  // parallel arrays, one element per container
       size_t n = reply.arrayForKey("ReplyIdsArray").size();
       EXPECT_GE(n, 1u);
       EXPECT_EQ(reply.arrayForKey("ReplyUUIDsArray").size(), n);
       EXPECT_EQ(reply.arrayForKey("ReplyPersonaUniqueStringsArray").size(), n);
     }},
    {2, "replaceContainer", "allowed", kUnprivileged, {},
     [](uid_t) {
       const char* id = "com.example.catalogue.replaced";
       QRVPlist old = container(kAllowedUID, id, 2), fresh = container(kAllowedUID, id, 2, /*transient=*/true);
       return QRVRequest(2)
           .set("OldIdentifier", str(id)).set("OldContainerClass", num(2))
           .set("OldContainerUUID", QRVPlist::data(old.dataForKey("ReplyUUID")))
           .set("NewIdentifier", str(id)).set("NewContainerClass", num(2))
           .set("NewContainerUUID", QRVPlist::data(fresh.dataForKey("ReplyUUID")));
     }},
    {3, "stageContainerForDelete", "allowed", kUnprivileged, {},
     [](uid_t) {
       const char* id = "com.example.catalogue.staged";
       QRVPlist uuid = QRVPlist::data(container(kAllowedUID, id, 1).dataForKey("ReplyUUID"));
       return QRVRequest(3)
           .set("ContainerClassesArray", QRVPlist::array({num(1)})).set("UUIDsArray", QRVPlist::array({uuid}))
           .set("IdentifiersArray", strings({id})).set("PersonaUniqueStringsArray", strings({""}));
     }},
    // Answered by the completion once death row is empty.
    {4, "deleteContainersOnDeathRow", "userManagedAssets", kUnprivileged, {}, [](uid_t) { return QRVRequest(4); }},
    {5, "setInfoValue", "allowed", kUnprivileged, {}, [](uid_t) { return setInfoValue(); }},
    {6, "infoValueForKey", "allowed", kUnprivileged, {"ReplyInfoValue"},
     [](uid_t) {
       EXPECT_EQ(code(ask(kAllowedUID, setInfoValue())), 1u);
       return onBundle(6).set("Key", str("k"));
     }},
    {7, "containerMetadata (info dictionary asked for)", "allowed", kUnprivileged,
     {"ReplyPath", "ReplyTransient", "ReplyInfoDictionary", "SandboxToken"},
     [](uid_t) { return onBundle(7).set("InfoDictRequested", QRVPlist::boolean(true)); }},
    {7, "containerMetadata", "allowed", kUnprivileged, {"ReplyPath", "ReplyTransient", "SandboxToken"},
     [](uid_t) { return onBundle(7); }},
    {8, "recreateDefaultStructure", "allowed", kUnprivileged, {}, [](uid_t) { return onBundle(8); }},
    {9, "regenerateDirectoryUUID", "allowed", kUnprivileged, {},
     [](uid_t) { return onBundle(9, "com.example.catalogue.renamed"); }},
    {10, "deleteContainer", "allowed", kUnprivileged, {},
     [](uid_t) {
       const char* id = "com.example.catalogue.deleted";
       container(kAllowedUID, id, 1);
       return QRVRequest(10).set("Identifier", str(id)).set("ContainerClass", num(1));
     }},
    // The wipe right lists its holder's own identifier; "allowed" may wipe
    // anything. Each wipes the container it sees.
    {11, "wipeContainerContent", "wipeContainer", kUnprivileged, {},
     [](uid_t caller) {
       ask(caller, QRVCreateRequest(kWipedID, 4));
       return QRVRequest(11).set("Identifier", str(kWipedID));
     }},
    {12, "deleteContainerContent", "deleteContainerContent", kUnprivileged, {},
     [](uid_t caller) {
       ask(caller, QRVCreateRequest(kCleanerID, 2));
       return QRVRequest(12).set("Identifier", str(kCleanerID)).set("ContainerClass", num(2));
     }},
    {13, "createOrLookupGroupContainers", "allowed", refuse({kStranger}), {"ReplyGroupContainerDict", "SandboxTokenDict"},
     [](uid_t) { return groupsOfPlain(13); },
     [](const QRVPlist& reply) {
       EXPECT_TRUE(reply.dictionaryForKey("ReplyGroupContainerDict").count(kAppGroup));
       EXPECT_TRUE(reply.dictionaryForKey("SandboxTokenDict").count(kAppGroup));
     }},
    {14, "groupContainerIdentifiersForOwner", "allowed", refuse({kStranger, kPlain, kOtherIdLookup}),
     {"ReplyGroupIdentifiersArray"}, [](uid_t) { return groupsOfPlain(14); }},
    {15, "lookupSystemContainer", "allowed", refuse({kStranger}), {"ReplyPath"},
     [](uid_t) { return QRVRequest(15).set("Identifier", str("com.kelva.fontservicesd")).set("ContainerClass", num(12)); }},
    {16, "groupContainersForOwner", "allowed", refuse({kStranger}), {"ReplyGroupContainerDict"},
     [](uid_t) { return groupsOfPlain(16); }},
    {17, "systemGroupContainerPath", "allowed", refuse({kStranger}), {"ReplyPath"},
     [](uid_t) { return QRVRequest(17).set("GroupIdentifier", str("systemgroup.com.kelva.quorva.shared")); }},
    {18, "processCodeSigningInfo", "allowed", kUnprivileged, {},
     [](uid_t) {
       QRVPlist info = QRVPlist::dictionary().set("com.kelva.Quorva.Entitlements", QRVPlist::dictionary());
       return QRVRequest(18).set("Identifier", str("com.example.catalogue.installed")).set("CodeSigningInfo", info);
     }},
    {19, "codeSigningInfoForIdentifier", "allowed", kUnprivileged, {"ReplyInfoDictionary"},
     [](uid_t) {
       installPlainCaller();
       return QRVRequest(19).set("Identifier", str(kPlainID));
     }},
    {20, "invalidateCodeSigningInfoForAppsWithoutBundleContainer", "allowed", kUnprivileged, {},
     [](uid_t) { return QRVRequest(20); }},
    // Answered by the completion once the change has ended.
    {21, "setDataProtection", "allowed", kUnprivileged, {},
     [](uid_t) {
       const char* id = "com.example.catalogue.protected";
       container(kAllowedUID, id, 2);
       return QRVRequest(21).set("Identifier", str(id)).set("ContainerClass", num(2))
           .set("DataProtectionClass", num(3)).set("RetryIfLocked", QRVPlist::boolean(true));
     }},
    {22, "recreateDefaultStructureAgain", "allowed", kUnprivileged, {}, [](uid_t) { return onBundle(22); }},
    {23, "diskUsage", "allowed", refuse({kStranger, kPlain, kOtherIdLookup}), {"ReplyDiskUsage"},
     [](uid_t) { return onBundle(23); }},
    {24, "performDataMigration", "dataMigration", kUnprivileged, {}, [](uid_t) { return QRVRequest(24); }},
    // A test command: "allowed" alone does not grant it.
    {25, "retryTest", "testability", kAllButItsRight, {},
     [](uid_t) { return QRVRequest(25).set("NumRetryCrashes", num(0)); }},
    // Staging needs the caller's own code signing to list the group, which
    // "allowed" alone does not give: the operation refuses it.
    {26, "stageSharedContent", "stageSharedContent", kAllButItsRight, {"ReplyPath"},
     [](uid_t) {
       container(kAllowedUID, kSystemGroup, 13);
       std::string item = "staged-" + std::to_string(++gFreshName);
       QRVWriteText(container(kAllowedUID, kStagerID, 12).stringForKey("ReplyPath") + "/" + item, "shared");
       return QRVRequest(26).set("Identifier", str(kSystemGroup)).set("SourcePath", str(item)).set("DestPath", str(item));
     }},
    {27, "retiredCommand", "allowed", refuse({kStranger, kPlain, kOtherIdLookup, kLookup, kAllowed}, 49), {},
     [](uid_t) { return QRVRequest(27); }},
    // Open to every identified caller, but only for its own identifier
    // unless it holds the right (a refusal of the operation: 38).
    {28, "userManagedAssetsPath", "userManagedAssets",
     {{kStranger, 55}, {kPlain, 38}, {kOtherIdLookup, 38}, {kLookup, 38}}, {"ReplyPath", "ReplyExisted"},
     [](uid_t) { return assetsPath(); }},
    // A fresh asset in the assets directory the caller itself is given.
    {29, "deleteUserManagedAsset", "userManagedAssets", kUnprivileged, {},
     [](uid_t caller) {
       std::string item = "asset-" + std::to_string(++gFreshName);
       QRVPlist assets = ask(caller, assetsPath());
       if (code(assets) == 1) QRVWriteText(assets.stringForKey("ReplyPath") + "/" + item, "asset");
       return QRVRequest(29).set("Identifier", str(kAssetsID)).set("SourcePath", str(item));
     }},
    {30, "performPerUserDataMigration", "allowed", kUnprivileged, {}, [](uid_t) { return QRVRequest(30); }},
    // Lock 6 is "release every test lock": harmless to the other rows.
    {31, "setTestLock", "testability", kAllButItsRight, {},
     [](uid_t) { return QRVRequest(31).set("TestLock", num(6)).set("Enable", QRVPlist::boolean(false)); }},
  };
  return kRows;
}
// clang-format on

std::set<std::string> keysOf(const QRVPlist& reply) {
  std::set<std::string> keys;
  for (const auto& [key, value] : reply.dictionaryValue()) keys.insert(key);
  return keys;
}

class CatalogueIntegrationTest : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    if (geteuid() != 0) return;
    gDaemon = std::make_unique<QRVDaemonProcess>();
    gDaemon->trustUID(kPlainUID, kPlainID, QRVPlist::dictionary());
    gDaemon->trustUID(kOtherIdUID, "com.example.catalogue.otherid", QRVEntitlements({"otherIdLookup"}));
    QRVPlist lookup = QRVPlist::dictionary()
                          .set("app", strings({kBundleID}))
                          .set("appData", strings({kPlainID}))
                          .set("appGroup", strings({kPlainID}));
    gDaemon->trustUID(kLookupUID, "com.example.catalogue.lookup",
                      QRVPlist::dictionary().set("com.kelva.private.Quorva.lookup", lookup));
    gDaemon->trustUID(kAllowedUID, "com.example.catalogue.allowed", QRVEntitlements({"allowed"}));
    for (const RightHolder& holder : kRightHolders) {
      std::string right = std::string("com.kelva.private.Quorva.") + holder.right;
      QRVPlist entitlements = QRVPlist::dictionary().set(right, QRVPlist::boolean(true));
      if (right.ends_with("wipeContainer")) entitlements.set(right, strings({kWipedID}));
      // The stager's code signing lists the group it stages into, and it
      // must be able to look that group up like any other container.
      if (right.ends_with("stageSharedContent"))
        entitlements.set("com.kelva.security.system-groups", strings({kSystemGroup}))
            .set("com.kelva.private.Quorva.otherIdLookup", QRVPlist::boolean(true))
            .set("com.kelva.security.system-container", QRVPlist::boolean(true));
      gDaemon->trustUID(holder.uid, holder.identifier, entitlements);
    }
    gDaemon->start();
  }
  static void TearDownTestSuite() { gDaemon.reset(); }

  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root: clients run under other uids";
  }

  static uid_t uidOf(Caller caller, const Row& row) {
    const uid_t uids[] = {kStrangerUID, kPlainUID, kOtherIdUID, kLookupUID, kAllowedUID};
    if (caller != kRightHolder) return uids[caller];
    for (const RightHolder& holder : kRightHolders)
      if (std::string(holder.right) == row.right) return holder.uid;
    ADD_FAILURE() << "no holder of " << row.right;
    return kStrangerUID;
  }

  // Sends every row of `commands` from every caller, the most powerful last
  // (so a command that changes something changes it once the refusals are
  // in), and checks each answer.
  void checkCommands(std::initializer_list<uint64_t> commands) {
    for (uint64_t n : commands) {
      bool covered = false;
      for (const Row& row : rows()) {
        if (row.command != n) continue;
        covered = true;
        std::vector<Caller> callers = {kStranger, kPlain, kOtherIdLookup, kLookup, kAllowed};
        if (std::string(row.right) != "allowed") callers.push_back(kRightHolder);
        for (Caller caller : callers) checkOne(row, caller);
      }
      EXPECT_TRUE(covered) << "command " << n << " has no row";
    }
  }

  void checkOne(const Row& row, Caller caller) {
    const std::string who =
        "command " + std::to_string(row.command) + " (" + row.name + ") from " + kCallerNames[caller];
    SCOPED_TRACE(who);
    const uid_t uid = uidOf(caller, row);
    const QRVPlist reply = ask(uid, row.request(uid));
    const auto refusal = row.refused.find(caller);
    const bool refused = refusal != row.refused.end();
    ASSERT_EQ(code(reply), refused ? refusal->second : 1u) << who << ": " << reply.description();
    std::set<std::string> expected = refused ? std::set<std::string>() : row.replyKeys;
    expected.insert("ReplyError");
    EXPECT_EQ(keysOf(reply), expected) << who << ": " << reply.description();
    if (!refused && row.check) row.check(reply);
  }
};

// Together the tests below cover the commands 0 to 31.
TEST_F(CatalogueIntegrationTest, ContainerCommands) {
  checkCommands({0, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 21, 22, 23});
}

TEST_F(CatalogueIntegrationTest, GroupSystemContainerAndCodeSigningCommands) {
  checkCommands({13, 14, 15, 16, 17, 18, 19, 20});
}

TEST_F(CatalogueIntegrationTest, AssetSharedContentTestAndRetiredCommands) { checkCommands({25, 26, 27, 28, 29, 31}); }

TEST_F(CatalogueIntegrationTest, MigrationCommands) { checkCommands({24, 30}); }

TEST_F(CatalogueIntegrationTest, NumbersPastTheTableAreInvalidForEveryCaller) {
  std::vector<QRVPlist> requests;
  for (uint64_t n : {uint64_t{32}, uint64_t{33}, uint64_t{1} << 32, std::numeric_limits<uint64_t>::max()})
    requests.push_back(QRVRequest(n));
  std::vector<uid_t> callers = {kStrangerUID, kPlainUID, kOtherIdUID, kLookupUID, kAllowedUID};
  for (const RightHolder& holder : kRightHolders) callers.push_back(holder.uid);
  for (uid_t uid : callers)
    for (const QRVPlist& reply : QRVRepliesAs(*gDaemon, uid, requests)) {
      EXPECT_EQ(code(reply), 49u) << "from uid " << uid;
      EXPECT_EQ(keysOf(reply), std::set<std::string>({"ReplyError"})) << "from uid " << uid;
    }
  EXPECT_TRUE(gDaemon->isRunning());
}

}  // namespace

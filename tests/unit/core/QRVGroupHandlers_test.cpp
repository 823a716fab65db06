// The group, system container and code-signing commands through the real
// dispatcher, command table and code-signing database: what each answers to
// callers with and without rights, and to malformed requests.
#include "core/QRVGroupHandlers.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

#include "base/QRVLog.h"
#include "codesigning/QRVCodeSigningMapping.h"
#include "codesigning/QRVWhitelist.h"
#include "core/QRVCommandTable.h"
#include "core/QRVRelayDispatcher.h"
#include "fs/QRVDictionaryAdditions.h"
#include "support/QRVRequests.h"
#include "support/QRVTestConnection.h"
#include "support/QRVTestServices.h"

namespace {

constexpr pid_t kInstaller = 700, kMail = 701, kNotes = 702, kDaemon = 703, kStranger = 799;

QRVPlist strings(std::initializer_list<const char*> values) {
  QRVPlist array = QRVPlist::array();
  for (const char* v : values) array.append(QRVPlist::string(v));
  return array;
}

QRVPlist processRequest(const std::string& identifier, std::optional<QRVPlist> info) {
  QRVPlist request = QRVRequest(18).set("Identifier", QRVPlist::string(identifier));
  if (info) request.set("CodeSigningInfo", *info);
  return request;
}

QRVPlist claiming(QRVPlist applicationGroups, QRVPlist systemGroups = QRVPlist::array()) {
  return QRVPlist::dictionary().set(kQRVCodeSigningEntitlementsKey,
                                    QRVPlist::dictionary()
                                        .set(kQRVApplicationGroupsEntitlement, std::move(applicationGroups))
                                        .set(kQRVSystemGroupsEntitlement, std::move(systemGroups)));
}

QRVPlist groupRequest(uint64_t command, std::optional<std::string> owner, uint64_t groupClass = 7) {
  QRVPlist request = QRVRequest(command).set("ContainerClass", QRVPlist::uinteger(groupClass));
  if (owner) request.set("Identifier", QRVPlist::string(*owner));
  return request;
}

class GroupHandlersTest : public testing::Test {
 protected:
  GroupHandlersTest() {
    env_.services->codeSigningMapping = std::make_shared<QRVCodeSigningMapping>(env_.services);
    env_.services->codeSigning = env_.services->codeSigningMapping;
    env_.trustStore->setClient(kInstaller, {"com.example.installer", QRVEntitlements({"allowed"})});
    // Applications: known to the trust store, holding no right of the daemon.
    env_.trustStore->setClient(kMail, {"com.example.mail", QRVPlist::dictionary()});
    env_.trustStore->setClient(kNotes, {"com.example.notes", QRVPlist::dictionary()});
    env_.trustStore->setClient(kDaemon, {"com.example.daemon", QRVPlist::dictionary()});
  }
  ~GroupHandlersTest() override { QRVLog::close(); }

  QRVPlist send(pid_t pid, const QRVPlist& request) {
    QRVRelayDispatcher dispatcher(env_.services, QRVDefaultCommandTable());
    auto connection = std::make_shared<QRVTestConnection>(pid);
    dispatcher.QRVProcessRelayEvent(connection, connection->message(request));
    EXPECT_EQ(connection->replies.size(), 1u);
    return connection->replies.empty() ? QRVPlist::dictionary() : connection->replies[0].second;
  }
  static uint64_t code(const QRVPlist& reply) { return reply.uint64ForKey("ReplyError"); }

  std::string startLog() {
    std::string path = env_.root.path() + "/handlers.log";
    QRVLog::open("com.kelva.quorvad", path, QRVLogLevel::kNotice, 1, 1 << 20);
    return path;
  }
  static std::string readLog(const std::string& path) {
    QRVLog::close();
    std::stringstream text;
    text << std::ifstream(path).rdbuf();
    return text.str();
  }

  QRVTestServices env_;
};

TEST_F(GroupHandlersTest, ApplicationsGetTheirOwnGroupsWithTokensAndOnlyTheirOwn) {
  ASSERT_EQ(
      code(send(kInstaller, processRequest("com.example.mail", claiming(strings({"group.shared", "group.mail"}))))),
      1u);
  ASSERT_EQ(code(send(kInstaller, processRequest("com.example.notes", claiming(strings({"group.shared"}))))), 1u);

  // 13 without an owner: the caller's own groups, with a token each.
  QRVPlist mail = send(kMail, groupRequest(13, std::nullopt));
  ASSERT_EQ(code(mail), 1u);
  const auto& paths = mail.dictionaryForKey("ReplyGroupContainerDict");
  ASSERT_EQ(paths.size(), 2u);
  const std::string shared = paths.at("group.shared").stringValue();
  EXPECT_TRUE(std::filesystem::is_directory(shared));
  EXPECT_EQ(mail.dictionaryForKey("SandboxTokenDict").at("group.shared").stringValue(),
            "com.kelva.sandbox.application-group;" + shared);
  // The other claimant, naming itself, gets the same directory.
  QRVPlist notes = send(kNotes, groupRequest(13, "com.example.notes"));
  ASSERT_EQ(code(notes), 1u);
  EXPECT_EQ(notes.dictionaryForKey("ReplyGroupContainerDict").at("group.shared").stringValue(), shared);
  EXPECT_EQ(notes.dictionaryForKey("ReplyGroupContainerDict").size(), 1u);

  // 16 answers the paths alone; 14 (for entitled callers) the identifiers.
  QRVPlist paths16 = send(kMail, groupRequest(16, std::nullopt));
  ASSERT_EQ(code(paths16), 1u);
  EXPECT_EQ(paths16.dictionaryForKey("ReplyGroupContainerDict"), paths);
  EXPECT_EQ(paths16.get("SandboxTokenDict"), nullptr);
  QRVPlist identifiers = send(kInstaller, groupRequest(14, "com.example.notes"));
  ASSERT_EQ(code(identifiers), 1u);
  EXPECT_EQ(identifiers.arrayForKey("ReplyGroupIdentifiersArray"), strings({"group.shared"}).arrayValue());
  EXPECT_EQ(code(send(kMail, groupRequest(14, std::nullopt))), 55u);  // 14 is not an open command

  // Another application's groups: refused, and the attempt is logged.
  const std::string log = startLog();
  EXPECT_EQ(code(send(kNotes, groupRequest(13, "com.example.mail"))), 55u);
  EXPECT_EQ(code(send(kNotes, groupRequest(16, "com.example.mail"))), 55u);
  // A caller the trust store does not know has no groups to name.
  EXPECT_EQ(code(send(kStranger, groupRequest(13, std::nullopt))), 55u);
  EXPECT_EQ(code(send(kStranger, groupRequest(13, "com.example.mail"))), 55u);
  const std::string text = readLog(log);
  EXPECT_NE(text.find("com.example.notes trying to look up persona for group owner com.example.mail"),
            std::string::npos)
      << text;
  EXPECT_NE(text.find("com.example.notes not entitled to retrieve group container class 7 with identifier "
                      "com.example.mail"),
            std::string::npos)
      << text;
}

TEST_F(GroupHandlersTest, SystemGroupPathsOnlyForListedGroupsAndTheSharedOne) {
  ASSERT_EQ(code(send(kInstaller, processRequest("com.example.daemon",
                                                 claiming(QRVPlist::array(), strings({"systemgroup.example"}))))),
            1u);
  auto path = [](const std::string& group) { return QRVRequest(17).set("GroupIdentifier", QRVPlist::string(group)); };
  const std::string log = startLog();
  EXPECT_EQ(code(send(kDaemon, path("systemgroup.other"))), 55u);
  // Listed but not well known: looked up, never made here.
  EXPECT_EQ(code(send(kDaemon, path("systemgroup.example"))), 21u);
  // The shared group is nobody's to refuse, and being well known it is made
  // on the first request, in a directory named after it.
  QRVPlist shared = send(kMail, path(QRVWhitelist::kSharedSystemGroupIdentifier));
  EXPECT_EQ(code(shared), 1u);
  EXPECT_EQ(QRVLastPathComponent(shared.stringForKey("ReplyPath")), QRVWhitelist::kSharedSystemGroupIdentifier);
  const std::string text = readLog(log);
  EXPECT_NE(text.find("com.example.daemon is not entitled for system group identifier: systemgroup.other.  Only "
                      "entitled for: "),
            std::string::npos)
      << text;
  EXPECT_NE(text.find("Did not find system group container with identifier: systemgroup.example for "
                      "com.example.daemon"),
            std::string::npos)
      << text;

  // Once the installer has made them, both are handed out.
  for (const char* group : {"systemgroup.example", QRVWhitelist::kSharedSystemGroupIdentifier}) {
    QRVPlist created = send(kInstaller, QRVCreateRequest(group, 13));
    ASSERT_EQ(code(created), 1u) << group;
    QRVPlist found = send(std::string(group) == "systemgroup.example" ? kDaemon : kMail, path(group));
    ASSERT_EQ(code(found), 1u) << group;
    EXPECT_EQ(found.stringForKey("ReplyPath"), created.stringForKey("ReplyPath"));
  }
  // The system groups of 13 are those the owner claims.
  QRVPlist groups = send(kDaemon, groupRequest(13, std::nullopt, 13));
  ASSERT_EQ(code(groups), 1u);
  EXPECT_EQ(groups.dictionaryForKey("ReplyGroupContainerDict").size(), 1u);
}

TEST_F(GroupHandlersTest, CodeSigningInformationIsStoredHandedOutAndRemoved) {
  QRVPlist info = claiming(strings({"group.mail"}));
  ASSERT_EQ(code(send(kInstaller, processRequest("com.example.mail", info))), 1u);
  QRVPlist stored = send(kInstaller, QRVRequest(19).set("Identifier", QRVPlist::string("com.example.mail")));
  ASSERT_EQ(code(stored), 1u);
  const QRVPlist* handedOut = stored.get("ReplyInfoDictionary");
  ASSERT_TRUE(handedOut && handedOut->get(kQRVCodeSigningEntitlementsKey));
  EXPECT_EQ(*handedOut->get(kQRVCodeSigningEntitlementsKey), *info.get(kQRVCodeSigningEntitlementsKey));
  // Applications may neither read nor write it.
  EXPECT_EQ(code(send(kMail, QRVRequest(19).set("Identifier", QRVPlist::string("com.example.mail")))), 55u);
  EXPECT_EQ(code(send(kMail, processRequest("com.example.mail", QRVPlist::dictionary()))), 55u);

  // Without information the entry goes, and with it the claim.
  ASSERT_EQ(code(send(kInstaller, processRequest("com.example.mail", std::nullopt))), 1u);
  EXPECT_EQ(code(send(kInstaller, QRVRequest(19).set("Identifier", QRVPlist::string("com.example.mail")))), 67u);
  QRVPlist none = send(kMail, groupRequest(13, std::nullopt));
  ASSERT_EQ(code(none), 1u);
  EXPECT_TRUE(none.dictionaryForKey("ReplyGroupContainerDict").empty());
  EXPECT_EQ(code(send(kInstaller, QRVRequest(20))), 1u);
}

TEST_F(GroupHandlersTest, MalformedRequestsAreAnsweredWithACode) {
  struct Case {
    const char* what;
    QRVPlist request;
    uint64_t code;
  } cases[] = {
      {"13 of a data class", groupRequest(13, std::nullopt, 2), 11},
      {"13 of class 14", groupRequest(13, std::nullopt, 14), 11},
      {"13 without a class", QRVRequest(13), 11},
      {"13 with the class as text", QRVRequest(13).set("ContainerClass", QRVPlist::string("7")), 11},
      {"13 with a numeric owner", groupRequest(13, std::nullopt).set("Identifier", QRVPlist::uinteger(5)), 11},
      {"14 with an array as owner", groupRequest(14, std::nullopt).set("Identifier", strings({"a"})), 11},
      {"16 of class 12", groupRequest(16, "com.example.installer", 12), 11},
      {"15 of a data class", QRVCreateRequest("com.example.system", 2).set("Command", QRVPlist::uinteger(15)), 11},
      {"15 without a class", QRVRequest(15).set("Identifier", QRVPlist::string("com.example.system")), 11},
      {"15 of an absent system container",
       QRVCreateRequest("com.example.system", 12).set("Command", QRVPlist::uinteger(15)), 21},
      {"17 without a group", QRVRequest(17), 18},
      {"17 with a numeric group", QRVRequest(17).set("GroupIdentifier", QRVPlist::uinteger(1)), 11},
      {"18 without an identifier", QRVRequest(18), 18},
      {"18 with a numeric identifier", QRVRequest(18).set("Identifier", QRVPlist::uinteger(1)), 11},
      {"18 with text as information", processRequest("com.example.a", QRVPlist::string("x")), 38},
      {"18 with an array of options",
       processRequest("com.example.a", QRVPlist::dictionary()).set("OptionsDictionary", strings({"x"})), 38},
      {"19 without an identifier", QRVRequest(19), 18},
      {"19 of an unknown identifier", QRVRequest(19).set("Identifier", QRVPlist::string("com.example.none")), 67},
  };
  for (const Case& c : cases) EXPECT_EQ(code(send(kInstaller, c.request)), c.code) << c.what;
}

}  // namespace

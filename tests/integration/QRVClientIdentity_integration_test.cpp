// Requests are attributed to the right client: by executable, by uid, and
// the installer's identity is rebuilt when its process restarts.
#include <gtest/gtest.h>

#include <unistd.h>

#include <regex>

#include "client/QRVClient.h"
#include "integration/QRVDaemonProcess.h"
#include "integration/QRVRunAs.h"
#include "support/QRVRequests.h"

namespace {

std::string selfExecutable() {
  char buf[4096];
  ssize_t n = readlink("/proc/self/exe", buf, sizeof buf - 1);
  return n > 0 ? std::string(buf, static_cast<size_t>(n)) : std::string();
}

// The addresses of the identities logged for `identifier`, one per request.
std::vector<std::string> loggedIdentities(const std::string& log, const std::string& identifier) {
  std::vector<std::string> out;
  std::regex line("\\[" + identifier + "\\] Relay client identity: <QRVClientIdentity: (0x[0-9a-f]+);");
  for (auto it = std::sregex_iterator(log.begin(), log.end(), line); it != std::sregex_iterator(); ++it)
    out.push_back((*it)[1]);
  return out;
}

class ClientIdentityIntegrationTest : public testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root: clients run under other uids";
  }
  QRVDaemonProcess daemon_;
};

TEST_F(ClientIdentityIntegrationTest, MatchedByExecutableAndByUID) {
  // This test binary, run as uid 3001, is "com.example.tool" with the test
  // right; any process of uid 3002 is "com.example.byuid" without it.
  daemon_.trustEntry("tool", QRVPlist::dictionary()
                                 .set("SigningIdentifier", QRVPlist::string("com.example.tool"))
                                 .set("Executable", QRVPlist::string(selfExecutable()))
                                 .set("UID", QRVPlist::uinteger(3001))
                                 .set("Entitlements", QRVPlist::dictionary().set(
                                                          "com.kelva.private.Quorva.testability",
                                                          QRVPlist::boolean(true))));
  daemon_.trustUID(3002, "com.example.byuid", QRVPlist::dictionary());
  // An entry for an executable that does not exist matches nobody.
  daemon_.trustEntry("ghost", QRVPlist::dictionary()
                                  .set("SigningIdentifier", QRVPlist::string("com.example.ghost"))
                                  .set("Executable", QRVPlist::string("/nonexistent/tool"))
                                  .set("Entitlements", QRVPlist::dictionary()));
  daemon_.start();
  auto testCodeAs = [&](uid_t uid) { return QRVClient::resultCode(QRVRepliesAs(daemon_, uid, {QRVRequest(25)})[0]); };
  EXPECT_EQ(testCodeAs(3001), 1u);
  EXPECT_EQ(testCodeAs(3002), 55u);
  EXPECT_EQ(testCodeAs(3003), 55u);
  std::string log = daemon_.readLog();
  EXPECT_EQ(loggedIdentities(log, "com.example.tool").size(), 1u);
  EXPECT_EQ(loggedIdentities(log, "com.example.byuid").size(), 1u);
  EXPECT_TRUE(loggedIdentities(log, "com.example.ghost").empty());
  EXPECT_NE(log.find("command=25, client=com.example.tool, error=1"), std::string::npos);

  // The trust store is re-read when it changes.
  daemon_.trustUID(3003, "com.example.late",
                   QRVPlist::dictionary().set("com.kelva.private.Quorva.testability", QRVPlist::boolean(true)));
  EXPECT_EQ(testCodeAs(3003), 1u);
}

TEST_F(ClientIdentityIntegrationTest, RestartedInstallerGetsAFreshIdentity) {
  daemon_.trustUID(3010, "com.kelva.verdaned",
                   QRVPlist::dictionary().set("com.kelva.private.Quorva.allowed", QRVPlist::boolean(true)));
  daemon_.start();
  // One process asks three times, then a new process twice.
  for (size_t count : {3, 2})
    for (const QRVPlist& reply : QRVRepliesAs(daemon_, 3010, std::vector<QRVPlist>(count, QRVRequest(32))))
      EXPECT_EQ(QRVClient::resultCode(reply), 49u);
  std::vector<std::string> ids = loggedIdentities(daemon_.readLog(), "com.kelva.verdaned");
  ASSERT_EQ(ids.size(), 5u);
  // The first process's requests share one identity; the restarted process
  // has another.
  EXPECT_EQ(ids[0], ids[1]);
  EXPECT_EQ(ids[1], ids[2]);
  EXPECT_EQ(ids[3], ids[4]);
  EXPECT_NE(ids[2], ids[3]);
}

}  // namespace

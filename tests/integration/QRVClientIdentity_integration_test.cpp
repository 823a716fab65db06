// Requests are attributed to the right client: by executable, by uid, and
// the installer's identity is rebuilt when its process restarts.
#include <gtest/gtest.h>

#include <unistd.h>

#include <regex>
#include <set>

#include "QRVClient.h"
#include "QRVDaemonProcess.h"
#include "QRVRunAs.h"

namespace {

QRVPlist request(uint64_t command) { return QRVPlist::dictionary().set("Command", QRVPlist::uinteger(command)); }

std::string selfExecutable() {
  char buf[4096];
  ssize_t n = readlink("/proc/self/exe", buf, sizeof buf - 1);
  return n > 0 ? std::string(buf, static_cast<size_t>(n)) : std::string();
}

// Sends `count` requests over one connection from a process running as uid;
// returns the result codes.
std::string ask(const QRVDaemonProcess& daemon, uid_t uid, uint64_t command, int count = 1) {
  return QRVRunAs(uid, uid, [&] {
           QRVClientError error;
           auto client = QRVClient::connect(daemon.root(), &error);
           if (!client) return std::string("connect-failed");
           std::string codes;
           for (int i = 0; i < count; i++) {
             auto reply = client->sendRequest(request(command), std::chrono::seconds(10), &error);
             codes += (codes.empty() ? "" : " ") + (reply ? std::to_string(QRVClient::resultCode(*reply)) : "x");
           }
           return codes;
         })
      .value_or("child-failed");
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
  EXPECT_EQ(ask(daemon_, 3001, 25), "1");
  EXPECT_EQ(ask(daemon_, 3002, 25), "55");
  EXPECT_EQ(ask(daemon_, 3003, 25), "55");
  std::string log = daemon_.readLog();
  EXPECT_EQ(loggedIdentities(log, "com.example.tool").size(), 1u);
  EXPECT_EQ(loggedIdentities(log, "com.example.byuid").size(), 1u);
  EXPECT_TRUE(loggedIdentities(log, "com.example.ghost").empty());
  EXPECT_NE(log.find("command=25, client=com.example.tool, error=1"), std::string::npos);

  // The trust store is re-read when it changes.
  daemon_.trustUID(3003, "com.example.late", QRVPlist::dictionary().set("com.kelva.private.Quorva.testability",
                                                                          QRVPlist::boolean(true)));
  EXPECT_EQ(ask(daemon_, 3003, 25), "1");
}

TEST_F(ClientIdentityIntegrationTest, RestartedInstallerGetsAFreshIdentity) {
  daemon_.trustUID(3010, "com.kelva.verdaned",
                   QRVPlist::dictionary().set("com.kelva.private.Quorva.allowed", QRVPlist::boolean(true)));
  daemon_.start();
  EXPECT_EQ(ask(daemon_, 3010, 32, 3), "49 49 49");  // one process, three requests
  EXPECT_EQ(ask(daemon_, 3010, 32, 2), "49 49");     // a new process
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

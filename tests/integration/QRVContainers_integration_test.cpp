// Containers obtained from the running daemon by client processes.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <sstream>

#include "QRVClient.h"
#include "QRVDaemonProcess.h"
#include "QRVRunAs.h"

namespace {

constexpr uid_t kAppUID = 2101;      // "com.example.app", no entitlements
constexpr uid_t kInstallerUID = 2102;  // "allowed"

QRVPlist createRequest(const std::string& identifier, uint64_t containerClass, bool transient = false) {
  return QRVPlist::dictionary()
      .set("Command", QRVPlist::uinteger(0))
      .set("Identifier", QRVPlist::string(identifier))
      .set("ContainerClass", QRVPlist::uinteger(containerClass))
      .set("CreateIfNecessary", QRVPlist::boolean(true))
      .set("Transient", QRVPlist::boolean(transient));
}

// Sends the requests from a process of `uid`; each reply is rendered as
// "code path existed uuid-hex" on its own line.
std::vector<std::string> repliesAs(const QRVDaemonProcess& daemon, uid_t uid, const std::vector<QRVPlist>& requests) {
  auto out = QRVRunAs(uid, uid, [&] {
    QRVClientError error;
    auto client = QRVClient::connect(daemon.root(), &error);
    if (!client) return std::string("connect-failed\n");
    std::ostringstream lines;
    for (const QRVPlist& r : requests) {
      auto reply = client->sendRequest(r, std::chrono::seconds(10), &error);
      if (!reply) {
        lines << "x\n";
        continue;
      }
      lines << QRVClient::resultCode(*reply) << " " << reply->stringForKey("ReplyPath") << " "
            << reply->boolForKey("ReplyExisted") << " ";
      for (uint8_t b : reply->dataForKey("ReplyUUID")) lines << std::hex << static_cast<int>(b);
      lines << std::dec << " " << reply->arrayForKey("ReplyIdsArray").size() << "\n";
    }
    return lines.str();
  });
  std::vector<std::string> result;
  std::istringstream in(out.value_or("child-failed\n"));
  for (std::string line; std::getline(in, line);) result.push_back(line);
  return result;
}

std::vector<std::string> fields(const std::string& line) {
  std::vector<std::string> f;
  std::istringstream in(line);
  for (std::string w; in >> w;) f.push_back(w);
  return f;
}

class ContainersIntegrationTest : public testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root: clients run under other uids";
    daemon_.trustUID(kAppUID, "com.example.app", QRVPlist::dictionary());
    daemon_.trustUID(kInstallerUID, "com.example.installer",
                     QRVPlist::dictionary().set("com.kelva.private.Quorva.allowed", QRVPlist::boolean(true)));
    daemon_.start();
  }
  QRVDaemonProcess daemon_;
};

TEST_F(ContainersIntegrationTest, AnApplicationGetsItsOwnDataContainer) {
  auto replies = repliesAs(daemon_, kAppUID,
                           {createRequest("com.example.app", 2), createRequest("com.example.app", 2),
                            createRequest("com.example.other", 2)});
  ASSERT_EQ(replies.size(), 3u);
  auto first = fields(replies[0]), second = fields(replies[1]);
  ASSERT_EQ(first.size(), 5u) << replies[0];
  EXPECT_EQ(first[0], "1");
  EXPECT_EQ(first[2], "0");  // created
  EXPECT_EQ(second[2], "1");  // existed
  EXPECT_EQ(second[1], first[1]);
  EXPECT_EQ(second[3], first[3]);
  EXPECT_EQ(fields(replies[2])[0], "55");

  // It lives in the mobile user's tree, owned by the caller, with its
  // default structure.
  const std::string& path = first[1];
  EXPECT_EQ(path.rfind(daemon_.root() + "/private/var/mobile/Containers/Data/Application/", 0), 0u) << path;
  struct stat st;
  ASSERT_EQ(stat(path.c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, kAppUID);
  EXPECT_TRUE(std::filesystem::is_directory(path + "/Library/Caches"));
}

TEST_F(ContainersIntegrationTest, InstallerCreatesListsAndLooksUpForOthers) {
  QRVPlist list = QRVPlist::dictionary().set("Command", QRVPlist::uinteger(1)).set("ContainerClass",
                                                                                   QRVPlist::uinteger(1));
  auto replies = repliesAs(daemon_, kInstallerUID,
                           {createRequest("com.example.a", 1), createRequest("com.example.b", 1), list,
                            createRequest("com.example.a", 2, true), createRequest("com.example.a", 2, true)});
  ASSERT_EQ(replies.size(), 5u);
  EXPECT_EQ(fields(replies[0])[0], "1");
  auto listed = fields(replies[2]);
  EXPECT_EQ(listed[0], "1");
  EXPECT_EQ(listed.back(), "2");  // two bundle containers
  // Bundle containers belong to the installer account.
  struct stat st;
  ASSERT_EQ(stat(fields(replies[0])[1].c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, 33u);
  // Two transient requests: two different, fresh containers.
  EXPECT_NE(fields(replies[3])[3], fields(replies[4])[3]);
  EXPECT_FALSE(std::filesystem::exists(fields(replies[3])[1]));
}

}  // namespace

// Info values, disk usage, user-managed assets, shared content and new
// directory UUIDs through the running daemon.
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <sstream>

#include "QRVClient.h"
#include "QRVDaemonProcess.h"
#include "QRVRunAs.h"

namespace fs = std::filesystem;

namespace {

constexpr uid_t kInstallerUID = 2112;
const char* const kInstaller = "com.example.installer";

QRVPlist request(uint64_t command) { return QRVPlist::dictionary().set("Command", QRVPlist::uinteger(command)); }

QRVPlist containerRequest(uint64_t command, const QRVPlist::Bytes& uuid) {
  return request(command)
      .set("Identifier", QRVPlist::string(kInstaller))
      .set("ContainerClass", QRVPlist::uinteger(2))
      .set("UUID", QRVPlist::data(uuid));
}

// One line per reply: "code path existed infoValue diskUsage" ("-" for an
// absent key).
std::string render(const QRVPlist& reply) {
  std::ostringstream line;
  auto orDash = [](const std::string& s) { return s.empty() ? std::string("-") : s; };
  line << QRVClient::resultCode(reply) << " " << orDash(reply.stringForKey("ReplyPath")) << " "
       << reply.boolForKey("ReplyExisted") << " " << orDash(reply.stringForKey("ReplyInfoValue")) << " "
       << reply.uint64ForKey("ReplyDiskUsage");
  return line.str();
}

std::vector<std::string> fields(const std::string& line) {
  std::vector<std::string> f;
  std::istringstream in(line);
  for (std::string w; in >> w;) f.push_back(w);
  return f;
}

class ContentsIntegrationTest : public testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root: clients run under other uids";
    daemon_.trustUID(kInstallerUID, kInstaller,
                     QRVPlist::dictionary()
                         .set("com.kelva.private.Quorva.allowed", QRVPlist::boolean(true))
                         .set("com.kelva.private.Quorva.userManagedAssets", QRVPlist::boolean(true))
                         .set("com.kelva.private.Quorva.stageSharedContent", QRVPlist::boolean(true)));
    daemon_.start();
  }

  // Runs the whole conversation in one client process: the container's UUID
  // from the first reply is used by the requests that follow.
  std::vector<std::string> converse() {
    auto out = QRVRunAs(kInstallerUID, kInstallerUID, [&] {
      QRVClientError error;
      auto client = QRVClient::connect(daemon_.root(), &error);
      if (!client) return std::string("connect-failed\n");
      std::ostringstream lines;
      auto send = [&](const QRVPlist& r) -> std::optional<QRVPlist> {
        auto reply = client->sendRequest(r, std::chrono::seconds(10), &error);
        lines << (reply ? render(*reply) : std::string("x")) << "\n";
        return reply;
      };
      auto created = send(request(0)
                              .set("Identifier", QRVPlist::string(kInstaller))
                              .set("ContainerClass", QRVPlist::uinteger(2))
                              .set("CreateIfNecessary", QRVPlist::boolean(true)));
      if (!created) return lines.str();
      const QRVPlist::Bytes uuid = created->dataForKey("ReplyUUID");
      send(containerRequest(5, uuid).set("Key", QRVPlist::string("k")).set("Value", QRVPlist::string("v")));  // 1
      send(containerRequest(6, uuid).set("Key", QRVPlist::string("k")));                                      // 2
      send(containerRequest(6, uuid).set("Key", QRVPlist::string("missing")));                                // 3
      send(containerRequest(5, uuid).set("Key", QRVPlist::uinteger(3)));                                      // 4
      send(containerRequest(23, uuid));                                                                       // 5
      auto assets = request(28).set("Identifier", QRVPlist::string(kInstaller));
      send(assets.set("CreateIfNecessary", QRVPlist::boolean(false)));                                       // 6
      send(assets.set("CreateIfNecessary", QRVPlist::boolean(true)));                                        // 7
      send(assets.set("IsRelative", QRVPlist::boolean(true)));                                               // 8
      for (const char* path : {".", "..", "../Documents", "/etc/passwd"})                                    // 9-12
        send(request(29).set("Identifier", QRVPlist::string(kInstaller)).set("SourcePath", QRVPlist::string(path)));
      send(request(26)                                                                                       // 13
               .set("Identifier", QRVPlist::string("systemgroup.com.example.shared"))
               .set("SourcePath", QRVPlist::string("Library"))
               .set("DestPath", QRVPlist::string("Library")));
      send(containerRequest(9, uuid));                                                                       // 14
      send(containerRequest(6, uuid).set("Key", QRVPlist::string("k")));                                      // 15
      send(request(0).set("Identifier", QRVPlist::string(kInstaller)).set("ContainerClass", QRVPlist::uinteger(2)));
      return lines.str();                                                                                    // 16
    });
    std::vector<std::string> result;
    std::istringstream in(out.value_or("child-failed\n"));
    for (std::string line; std::getline(in, line);) result.push_back(line);
    return result;
  }

  QRVDaemonProcess daemon_;
};

TEST_F(ContentsIntegrationTest, TheContentsCommandsWorkAndRefuseBadInputWhileTheDaemonKeepsServing) {
  auto replies = converse();
  ASSERT_EQ(replies.size(), 17u) << (replies.empty() ? "" : replies[0]);
  auto created = fields(replies[0]);
  ASSERT_EQ(created[0], "1") << replies[0];
  const std::string container = created[1];

  EXPECT_EQ(fields(replies[1])[0], "1") << replies[1];
  EXPECT_EQ(fields(replies[2])[0], "1");
  EXPECT_EQ(fields(replies[2])[3], "v");
  EXPECT_EQ(fields(replies[3])[0], "24");
  EXPECT_EQ(fields(replies[4])[0], "38");
  EXPECT_EQ(fields(replies[5])[0], "1") << replies[5];
  EXPECT_GT(std::stoull(fields(replies[5])[4]), 0u);

  EXPECT_EQ(fields(replies[6])[0], "71");
  auto madeAssets = fields(replies[7]);
  ASSERT_EQ(madeAssets[0], "1") << replies[7];
  EXPECT_EQ(madeAssets[2], "0");
  EXPECT_EQ(fs::path(madeAssets[1]).parent_path().string(), container);
  auto relative = fields(replies[8]);
  EXPECT_EQ(relative[1], fs::path(madeAssets[1]).filename().string());
  EXPECT_EQ(relative[2], "1");

  for (int i = 9; i <= 11; i++) EXPECT_EQ(fields(replies[i])[0], "10") << replies[i];
  EXPECT_EQ(fields(replies[12])[0], "11") << replies[12];
  EXPECT_TRUE(fs::exists("/etc/passwd"));

  // No code signing connected: no system group is granted.
  EXPECT_EQ(fields(replies[13])[0], "55");

  EXPECT_EQ(fields(replies[14])[0], "1") << replies[14];
  EXPECT_FALSE(fs::exists(container));
  // The old UUID names nothing; the identifier's container has moved.
  EXPECT_EQ(fields(replies[15])[0], "21");
  auto again = fields(replies[16]);
  ASSERT_EQ(again[0], "1") << replies[16];
  EXPECT_NE(again[1], container);
  EXPECT_EQ(fs::path(again[1]).parent_path(), fs::path(container).parent_path());
  EXPECT_TRUE(fs::is_directory(fs::path(again[1]) / fs::path(madeAssets[1]).filename()));
  EXPECT_TRUE(daemon_.isRunning());
}

}  // namespace

// Info values, disk usage, user-managed assets, shared content and new
// directory UUIDs through the running daemon.
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>

#include "client/QRVClient.h"
#include "integration/QRVRunAs.h"
#include "support/QRVDaemonTest.h"

namespace fs = std::filesystem;

namespace {

constexpr uid_t kInstallerUID = 2112;
const char* const kInstaller = "com.example.installer";

class ContentsIntegrationTest : public QRVDaemonTest {
 protected:
  void SetUp() override {
    startDaemon({{kInstallerUID, kInstaller, QRVEntitlements({"allowed", "userManagedAssets", "stageSharedContent"})}});
  }
};

TEST_F(ContentsIntegrationTest, TheContentsCommandsWorkAndRefuseBadInputWhileTheDaemonKeepsServing) {
  QRVPlist lookup =
      QRVRequest(0).set("Identifier", QRVPlist::string(kInstaller)).set("ContainerClass", QRVPlist::uinteger(2));
  QRVPlist created =
      QRVRepliesAs(daemon_, kInstallerUID, {QRVPlist(lookup).set("CreateIfNecessary", QRVPlist::boolean(true))})[0];
  ASSERT_EQ(QRVClient::resultCode(created), 1u) << created.description();
  const std::string container = created.stringForKey("ReplyPath");
  // The container commands name it by identifier, class and UUID.
  auto in = [&](uint64_t command) {
    return QRVPlist(lookup)
        .set("Command", QRVPlist::uinteger(command))
        .set("UUID", QRVPlist::data(created.dataForKey("ReplyUUID")));
  };
  auto key = [](const char* k) { return QRVPlist::string(k); };
  QRVPlist assets = QRVRequest(28).set("Identifier", key(kInstaller));
  auto source = [&](const char* path) {
    return QRVRequest(29).set("Identifier", key(kInstaller)).set("SourcePath", key(path));
  };
  std::vector<QRVPlist> requests = {
      in(5).set("Key", key("k")).set("Value", key("v")),                    // 0
      in(6).set("Key", key("k")),                                           // 1
      in(6).set("Key", key("missing")),                                     // 2
      in(5).set("Key", QRVPlist::uinteger(3)),                              // 3
      in(23),                                                               // 4
      QRVPlist(assets).set("CreateIfNecessary", QRVPlist::boolean(false)),  // 5
      assets.set("CreateIfNecessary", QRVPlist::boolean(true)),             // 6
      assets.set("IsRelative", QRVPlist::boolean(true)),                    // 7
      source("."),                                                          // 8
      source(".."),                                                         // 9
      source("../Documents"),                                               // 10
      source("/etc/passwd"),                                                // 11
      QRVRequest(26)                                                           // 12
          .set("Identifier", key("systemgroup.com.example.shared"))
          .set("SourcePath", key("Library"))
          .set("DestPath", key("Library")),
      in(9),                       // 13
      in(6).set("Key", key("k")),  // 14
      lookup,                      // 15
  };
  auto r = QRVRepliesAs(daemon_, kInstallerUID, requests);

  EXPECT_EQ(QRVClient::resultCode(r[0]), 1u) << r[0].description();
  EXPECT_EQ(QRVClient::resultCode(r[1]), 1u);
  EXPECT_EQ(r[1].stringForKey("ReplyInfoValue"), "v");
  EXPECT_EQ(QRVClient::resultCode(r[2]), 24u);
  EXPECT_EQ(QRVClient::resultCode(r[3]), 38u);
  EXPECT_EQ(QRVClient::resultCode(r[4]), 1u) << r[4].description();
  EXPECT_GT(r[4].uint64ForKey("ReplyDiskUsage"), 0u);

  EXPECT_EQ(QRVClient::resultCode(r[5]), 71u);
  ASSERT_EQ(QRVClient::resultCode(r[6]), 1u) << r[6].description();
  const fs::path madeAssets = r[6].stringForKey("ReplyPath");
  EXPECT_FALSE(r[6].boolForKey("ReplyExisted"));
  EXPECT_EQ(madeAssets.parent_path().string(), container);
  EXPECT_EQ(r[7].stringForKey("ReplyPath"), madeAssets.filename().string());
  EXPECT_TRUE(r[7].boolForKey("ReplyExisted"));

  // Asset paths must stay strictly inside the assets directory.
  for (int i = 8; i <= 10; i++) EXPECT_EQ(QRVClient::resultCode(r[i]), 10u) << r[i].description();
  EXPECT_EQ(QRVClient::resultCode(r[11]), 11u) << r[11].description();
  EXPECT_TRUE(fs::exists("/etc/passwd"));

  // No code signing connected: no system group is granted.
  EXPECT_EQ(QRVClient::resultCode(r[12]), 55u);

  // A new directory UUID moves the container; the old UUID names nothing.
  EXPECT_EQ(QRVClient::resultCode(r[13]), 1u) << r[13].description();
  EXPECT_FALSE(fs::exists(container));
  EXPECT_EQ(QRVClient::resultCode(r[14]), 21u);
  ASSERT_EQ(QRVClient::resultCode(r[15]), 1u) << r[15].description();
  const fs::path moved = r[15].stringForKey("ReplyPath");
  EXPECT_NE(moved, container);
  EXPECT_EQ(moved.parent_path(), fs::path(container).parent_path());
  EXPECT_TRUE(fs::is_directory(moved / madeAssets.filename()));
  EXPECT_TRUE(daemon_.isRunning());
}

}  // namespace

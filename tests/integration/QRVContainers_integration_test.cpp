// Containers obtained from the running daemon by client processes.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "client/QRVClient.h"
#include "integration/QRVRunAs.h"
#include "support/QRVDaemonTest.h"

namespace {

constexpr uid_t kAppUID = 2101;        // "com.example.app", no entitlements
constexpr uid_t kInstallerUID = 2102;  // "allowed"

class ContainersIntegrationTest : public QRVDaemonTest {
 protected:
  void SetUp() override {
    startDaemon({{kAppUID, "com.example.app", QRVPlist::dictionary()},
                 {kInstallerUID, "com.example.installer", QRVEntitlements({"allowed"})}});
  }
};

TEST_F(ContainersIntegrationTest, AnApplicationGetsItsOwnDataContainer) {
  auto r = QRVRepliesAs(daemon_, kAppUID,
                        {QRVCreateRequest("com.example.app", 2), QRVCreateRequest("com.example.app", 2),
                         QRVCreateRequest("com.example.other", 2)});
  ASSERT_EQ(QRVClient::resultCode(r[0]), 1u) << r[0].description();
  EXPECT_FALSE(r[0].boolForKey("ReplyExisted"));
  EXPECT_TRUE(r[1].boolForKey("ReplyExisted"));
  const std::string& path = r[0].stringForKey("ReplyPath");
  EXPECT_EQ(r[1].stringForKey("ReplyPath"), path);
  EXPECT_EQ(r[0].dataForKey("ReplyUUID").size(), 16u);
  EXPECT_EQ(r[1].dataForKey("ReplyUUID"), r[0].dataForKey("ReplyUUID"));
  // Another application's identifier is not the caller's to ask for.
  EXPECT_EQ(QRVClient::resultCode(r[2]), 55u);

  // It lives in the mobile user's tree, owned by the caller, with its
  // default structure.
  EXPECT_EQ(path.rfind(daemon_.root() + "/private/var/mobile/Containers/Data/Application/", 0), 0u) << path;
  struct stat st;
  ASSERT_EQ(stat(path.c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, kAppUID);
  EXPECT_TRUE(std::filesystem::is_directory(path + "/Library/Caches"));
}

TEST_F(ContainersIntegrationTest, InstallerCreatesListsAndLooksUpForOthers) {
  QRVPlist list =
      QRVPlist::dictionary().set("Command", QRVPlist::uinteger(1)).set("ContainerClass", QRVPlist::uinteger(1));
  auto r = QRVRepliesAs(daemon_, kInstallerUID,
                        {QRVCreateRequest("com.example.a", 1), QRVCreateRequest("com.example.b", 1), list,
                         QRVCreateRequest("com.example.a", 2, true), QRVCreateRequest("com.example.a", 2, true)});
  ASSERT_EQ(QRVClient::resultCode(r[0]), 1u) << r[0].description();
  EXPECT_EQ(QRVClient::resultCode(r[2]), 1u);
  EXPECT_EQ(r[2].arrayForKey("ReplyIdsArray").size(), 2u);  // two bundle containers
  // Bundle containers belong to the installer account.
  struct stat st;
  ASSERT_EQ(stat(r[0].stringForKey("ReplyPath").c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, 33u);
  // Two transient requests: two different, fresh containers.
  ASSERT_EQ(QRVClient::resultCode(r[3]), 1u);
  ASSERT_EQ(QRVClient::resultCode(r[4]), 1u);
  EXPECT_NE(r[3].dataForKey("ReplyUUID"), r[4].dataForKey("ReplyUUID"));
  // The first one is gone once the second replaced it.
  EXPECT_FALSE(r[3].stringForKey("ReplyPath").empty());
  EXPECT_FALSE(std::filesystem::exists(r[3].stringForKey("ReplyPath")));
}

}  // namespace

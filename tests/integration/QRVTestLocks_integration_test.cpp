// The test-lock command on a running daemon of an internal build.
#include <gtest/gtest.h>

#include "client/QRVClient.h"
#include "integration/QRVRunAs.h"
#include "support/QRVDaemonTest.h"
#include "support/QRVRequests.h"

namespace {

constexpr uid_t kTesterUID = 2301;
constexpr uid_t kInstallerUID = 2302;

QRVPlist testLock(uint64_t lock, bool enable) {
  return QRVRequest(31).set("TestLock", QRVPlist::uinteger(lock)).set("Enable", QRVPlist::boolean(enable));
}

class TestLocksIntegrationTest : public QRVDaemonTest {
 protected:
  void SetUp() override {
    startDaemon({{kTesterUID, "com.example.tester", QRVEntitlements({"testability"})},
                 {kInstallerUID, "com.example.installer", QRVEntitlements({"allowed"})}});
  }

  std::vector<uint64_t> codes(uid_t uid, const std::vector<QRVPlist>& requests) {
    std::vector<uint64_t> out;
    for (const QRVPlist& reply : QRVRepliesAs(daemon_, uid, requests)) out.push_back(QRVClient::resultCode(reply));
    return out;
  }
};

TEST_F(TestLocksIntegrationTest, BothGlobalTestLocksAtOnceAreRefusedAndTheDaemonKeepsServing) {
  EXPECT_EQ(codes(kTesterUID, {testLock(1, true), testLock(0, true), testLock(6, false)}),
            std::vector<uint64_t>({1, 38, 1}));
  EXPECT_TRUE(daemon_.logEventuallyContains("Refusing test lock 0"));
  EXPECT_EQ(codes(kTesterUID, {testLock(0, true), testLock(1, true), testLock(0, false)}),
            std::vector<uint64_t>({1, 38, 1}));
  EXPECT_EQ(codes(kInstallerUID, {QRVCreateRequest("com.example.app", 2)}), std::vector<uint64_t>({1}));
}

}  // namespace

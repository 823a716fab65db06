// The real daemon, reached from separate processes under different uids.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>

#include "base/QRVWireFrame.h"
#include "client/QRVClient.h"
#include "integration/QRVDaemonProcess.h"
#include "integration/QRVRunAs.h"
#include "support/QRVEventually.h"
#include "support/QRVRequests.h"

namespace {

constexpr uid_t kAllowedUID = 2001;   // "com.kelva.private.Quorva.allowed"
constexpr uid_t kPlainUID = 2002;     // known, no entitlements
constexpr uid_t kTesterUID = 2003;    // testability only
constexpr uid_t kStrangerUID = 2004;  // not in the trust store

// The result codes of the replies to `requests` sent from a process of `uid`.
std::vector<uint64_t> codesAs(const QRVDaemonProcess& daemon, uid_t uid, const std::vector<QRVPlist>& requests) {
  std::vector<uint64_t> codes;
  for (const QRVPlist& reply : QRVRepliesAs(daemon, uid, requests)) codes.push_back(QRVClient::resultCode(reply));
  return codes;
}
using Codes = std::vector<uint64_t>;

// Raw writes on a client's socket, for frames the client library would
// never send.
bool sendRaw(const QRVClient& client, const std::vector<uint8_t>& bytes) {
  return ::send(client.fd(), bytes.data(), bytes.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(bytes.size());
}

// True when the daemon closes the connection within the timeout (replies it
// sent first are read and dropped).
bool closedByPeer(const QRVClient& client, int timeoutMs = 5000) {
  for (char buf[4096];;) {
    pollfd p{client.fd(), POLLIN, 0};
    if (poll(&p, 1, timeoutMs) <= 0) return false;
    if (recv(client.fd(), buf, sizeof buf, 0) <= 0) return true;
  }
}

std::vector<uint8_t> frame(uint32_t length, uint32_t flags, uint64_t id, const std::vector<uint8_t>& body) {
  std::vector<uint8_t> bytes(QRVWireFrame::kHeaderSize);
  QRVWireFrame::encodeHeader({length, flags, id}, bytes.data());
  bytes.insert(bytes.end(), body.begin(), body.end());
  return bytes;
}

class DispatchIntegrationTest : public testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root: clients run under other uids";
    daemon_.trustUID(kAllowedUID, "com.example.allowed",
                     QRVPlist::dictionary().set("com.kelva.private.Quorva.allowed", QRVPlist::boolean(true)));
    daemon_.trustUID(kPlainUID, "com.example.plain", QRVPlist::dictionary());
    daemon_.trustUID(kTesterUID, "com.example.tester",
                     QRVPlist::dictionary().set("com.kelva.private.Quorva.testability", QRVPlist::boolean(true)));
    startup_ = daemon_.start({"--write-stall-timeout", "1000"});
    ASSERT_TRUE(daemon_.isRunning());
  }

  QRVDaemonProcess daemon_;
  std::chrono::milliseconds startup_{0};
};

TEST_F(DispatchIntegrationTest, CommandsAreDispatchedByNumberAndGatedByTheCallersEntitlements) {
  RecordProperty("startup_ms", static_cast<int>(startup_.count()));
  QRVPlist retry = QRVRequest(25).set("NumRetryCrashes", QRVPlist::uinteger(0));
  // Without "Command" the request is a create-or-lookup: the caller gets its
  // own container, and a request without an identifier is refused with 18.
  QRVPlist create = QRVPlist::dictionary()
                        .set("Identifier", QRVPlist::string("com.example.plain"))
                        .set("ContainerClass", QRVPlist::uinteger(2))
                        .set("CreateIfNecessary", QRVPlist::boolean(true));
  // Unknown numbers and the retired command are invalid for everybody,
  // entitled or not.
  EXPECT_EQ(codesAs(daemon_, kAllowedUID, {QRVRequest(32), QRVRequest(27), retry}), Codes({49, 49, 55}));
  EXPECT_EQ(codesAs(daemon_, kPlainUID, {QRVRequest(27), QRVRequest(32), retry, create, QRVPlist::dictionary()}),
            Codes({49, 49, 55, 1, 18}));
  // A stranger has no identity at all; the open command 0 refuses it too.
  EXPECT_EQ(codesAs(daemon_, kStrangerUID, {retry, create}), Codes({55, 55}));
  EXPECT_EQ(codesAs(daemon_, kTesterUID, {retry}), Codes({1}));
  EXPECT_TRUE(daemon_.logEventuallyContains("command=25, client=com.example.plain, error=55"));
  EXPECT_TRUE(daemon_.logEventuallyContains("command=0, client=com.example.plain, error=1"));
  EXPECT_TRUE(daemon_.logEventuallyContains("command=0, client=com.example.plain, error=18"));
  EXPECT_TRUE(daemon_.logEventuallyContains("connection attempt from pid"));
}

TEST_F(DispatchIntegrationTest, PipelinedRequestsAreAnsweredInOrder) {
  QRVClientError error;
  auto client = QRVClient::connect(daemon_.root(), &error);
  ASSERT_TRUE(client) << error.message;
  std::vector<uint64_t> ids;
  for (int i = 0; i < 200; i++) {
    auto id = client->send(QRVRequest(i % 2 ? 25 : 32), std::chrono::seconds(10), &error);
    ASSERT_TRUE(id) << error.message;
    ids.push_back(*id);
  }
  for (int i = 0; i < 200; i++) {
    auto reply = client->receive(std::chrono::seconds(10), &error);
    ASSERT_TRUE(reply) << error.message;
    ASSERT_EQ(reply->messageId, ids[i]) << "reply " << i;
    ASSERT_EQ(QRVClient::resultCode(reply->body), i % 2 ? 55u : 49u) << "reply " << i;
  }
}

TEST_F(DispatchIntegrationTest, BadFramesCloseOnlyTheirOwnConnection) {
  // A well-behaved client connected before the bad ones and used after them.
  QRVClientError error;
  auto good = QRVClient::connect(daemon_.root(), &error);
  ASSERT_TRUE(good) << error.message;

  std::vector<uint8_t> dict = QRVRequest(32).toBinary();
  std::vector<uint8_t> array = QRVPlist::array({QRVPlist::uinteger(1)}).toBinary();
  const std::vector<std::pair<std::string, std::vector<uint8_t>>> bad = {
      {"oversized", frame(QRVWireFrame::kMaxBodySize + 1, 1, 1, {})},
      {"not a dictionary", frame(static_cast<uint32_t>(array.size()), 1, 1, array)},
      {"garbage body", frame(8, 1, 1, {1, 2, 3, 4, 5, 6, 7, 8})},
      {"no reply context", frame(static_cast<uint32_t>(dict.size()), 0, 1, dict)},
      // Half a frame, then the client stops writing.
      {"truncated", frame(100, 1, 1, {1, 2, 3})},
  };
  for (const auto& [what, bytes] : bad) {
    auto s = QRVClient::connect(daemon_.root(), &error);
    ASSERT_TRUE(s && sendRaw(*s, bytes)) << what;
    if (what == "truncated") shutdown(s->fd(), SHUT_WR);
    EXPECT_TRUE(closedByPeer(*s)) << what;
  }
  // A client that disconnects right after asking.
  auto gone = QRVClient::connect(daemon_.root(), &error);
  ASSERT_TRUE(gone && sendRaw(*gone, frame(static_cast<uint32_t>(dict.size()), 1, 1, dict)));
  gone.reset();

  auto reply = good->sendRequest(QRVRequest(32), std::chrono::seconds(5), &error);
  ASSERT_TRUE(reply) << error.message;
  EXPECT_EQ(QRVClient::resultCode(*reply), 49u);
  EXPECT_TRUE(daemon_.isRunning());
  EXPECT_TRUE(daemon_.logEventuallyContains("exceeds the limit"));
  EXPECT_TRUE(daemon_.logEventuallyContains("Dictionary does not have reply context"));
}

TEST_F(DispatchIntegrationTest, ClientThatNeverReadsIsCutOffWithoutSlowingOthers) {
  QRVClientError error;
  auto slow = QRVClient::connect(daemon_.root(), &error);
  ASSERT_TRUE(slow) << error.message;
  int flags = fcntl(slow->fd(), F_GETFL);
  fcntl(slow->fd(), F_SETFL, flags | O_NONBLOCK);
  std::vector<uint8_t> dict = QRVRequest(32).toBinary();
  std::vector<uint8_t> one = frame(static_cast<uint32_t>(dict.size()), 1, 1, dict);
  // Ask until the daemon stops taking requests (for 300 ms): its replies are
  // not being read, so it has stopped reading.
  size_t sent = 0;
  auto lastAccepted = std::chrono::steady_clock::now();
  for (int round = 0; round < 500; round++) {
    while (::send(slow->fd(), one.data(), one.size(), MSG_NOSIGNAL) > 0) {
      sent++;
      lastAccepted = std::chrono::steady_clock::now();
    }
    if (std::chrono::steady_clock::now() - lastAccepted > std::chrono::milliseconds(300)) break;
    usleep(10'000);
  }
  EXPECT_GT(sent, 0u);
  // Everybody else is still served at once.
  EXPECT_EQ(codesAs(daemon_, kPlainUID, {QRVRequest(27)}), Codes({49}));
  // After the stall timeout the slow client is closed.
  fcntl(slow->fd(), F_SETFL, flags);
  EXPECT_TRUE(daemon_.logEventuallyContains("client is not reading its replies", std::chrono::seconds(10)));
  EXPECT_TRUE(closedByPeer(*slow, 10'000));
  EXPECT_TRUE(daemon_.isRunning());
}

TEST_F(DispatchIntegrationTest, RetryTestCrashesTheDaemonAsOftenAsAsked) {
  QRVPlist retry = QRVRequest(25).set("NumRetryCrashes", QRVPlist::uinteger(1));
  // The first attempt takes the daemon down without a reply...
  EXPECT_EQ(codesAs(daemon_, kTesterUID, {retry}), Codes({0}));
  auto status = daemon_.waitForExit(std::chrono::seconds(10));
  ASSERT_TRUE(status.has_value());
  EXPECT_TRUE(WIFSIGNALED(*status) || WEXITSTATUS(*status) != 0);
  // ...and the retry after the restart succeeds.
  daemon_.start({"--write-stall-timeout", "1000"});
  EXPECT_EQ(codesAs(daemon_, kTesterUID, {retry}), Codes({1}));
}

TEST_F(DispatchIntegrationTest, SecondStartInTheSameBootSkipsTheBootWork) {
  const std::string rebootDone = daemon_.root() + "/run/quorva/notify/com.kelva.quorvad.reboot-cleanup-complete";
  const std::string cleanupDone = daemon_.root() + "/run/quorva/notify/com.kelva.quorvad.cleanup-complete";
  // The notification is posted right after the line is logged.
  ASSERT_TRUE(daemon_.logEventuallyContains("quorvad first boot cleanup complete"));
  EXPECT_TRUE(QRVEventually([&] { return std::filesystem::exists(rebootDone); }, std::chrono::seconds(10)));
  daemon_.stop();
  std::filesystem::remove(rebootDone);
  std::filesystem::remove(cleanupDone);
  size_t before = daemon_.readLog().size();

  daemon_.start();
  EXPECT_TRUE(QRVEventually([&] { return std::filesystem::exists(cleanupDone); }, std::chrono::seconds(10)));
  std::string second = daemon_.readLog().substr(before);
  EXPECT_EQ(second.find("performing first boot initialization"), std::string::npos);
  EXPECT_EQ(second.find("reboot set-up"), std::string::npos);
  EXPECT_FALSE(std::filesystem::exists(rebootDone));
}

}  // namespace

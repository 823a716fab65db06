// What a client can hold of the daemon: a frame it starts must be finished in
// time, and only so many connections are served at once.
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <optional>
#include <vector>

#include "base/QRVWireFrame.h"
#include "client/QRVClient.h"
#include "integration/QRVDaemonProcess.h"
#include "support/QRVEventually.h"
#include "support/QRVRequests.h"

namespace {

constexpr int kReadStallMillis = 500;
constexpr size_t kMaxConnections = 4;

// True when the daemon answers a ping on `client`.
bool served(QRVClient& client) {
  QRVClientError error;
  return client.sendRequest(QRVRequest(32), std::chrono::seconds(5), &error).has_value();
}

// A connection the daemon has taken and serves (it may refuse while
// connections of earlier tests or of the start-up probe are being closed).
std::optional<QRVClient> servedConnection(const std::string& root) {
  std::optional<QRVClient> client;
  QRVEventually([&] {
    QRVClientError error;
    client = QRVClient::connect(root, &error);
    return client && served(*client);
  });
  return client;
}

// True when the daemon closes the connection within `timeoutMs`.
bool closedByPeer(int fd, int timeoutMs = 5000) {
  for (char buf[4096];;) {
    pollfd p{fd, POLLIN, 0};
    if (poll(&p, 1, timeoutMs) <= 0) return false;
    if (recv(fd, buf, sizeof buf, 0) <= 0) return true;
  }
}

class ConnectionLimitsTest : public testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "the daemon runs as root";
    daemon_.start({"--read-stall-timeout", std::to_string(kReadStallMillis), "--max-connections",
                   std::to_string(kMaxConnections)});
    ASSERT_TRUE(daemon_.isRunning());
  }

  QRVDaemonProcess daemon_;
};

TEST_F(ConnectionLimitsTest, ClientThatTricklesAFrameIsCutWhileIdleAndPromptClientsStay) {
  std::optional<QRVClient> idle = servedConnection(daemon_.root());
  ASSERT_TRUE(idle);
  std::optional<QRVClient> slow = servedConnection(daemon_.root());
  ASSERT_TRUE(slow);

  // A header announcing 100 bytes, then one byte every 100 ms: the frame is
  // never finished in time although bytes keep coming.
  std::vector<uint8_t> header(QRVWireFrame::kHeaderSize);
  QRVWireFrame::encodeHeader({100, QRVWireFrame::kFlagWantsReply, 7}, header.data());
  ASSERT_EQ(::send(slow->fd(), header.data(), header.size(), MSG_NOSIGNAL), static_cast<ssize_t>(header.size()));
  auto started = std::chrono::steady_clock::now();
  bool closed = false;
  for (int i = 0; i < 99 && !closed; i++) {
    uint8_t byte = 0;
    if (::send(slow->fd(), &byte, 1, MSG_NOSIGNAL) != 1) {
      closed = true;
      break;
    }
    closed = closedByPeer(slow->fd(), 100);
  }
  EXPECT_TRUE(closed) << "a client trickling one byte every 100 ms kept its connection";
  EXPECT_GE(std::chrono::steady_clock::now() - started, std::chrono::milliseconds(kReadStallMillis));
  EXPECT_TRUE(daemon_.logEventuallyContains("left a frame unfinished for more than 500 ms"));

  // The connection that sat idle all along (longer than the read timeout)
  // is still served, and so is a new one.
  EXPECT_TRUE(served(*idle));
  EXPECT_TRUE(servedConnection(daemon_.root()));
}

TEST_F(ConnectionLimitsTest, ConnectionsBeyondTheBoundAreRefusedUntilOneCloses) {
  std::vector<QRVClient> held;
  for (size_t i = 0; i < kMaxConnections; i++) {
    std::optional<QRVClient> client = servedConnection(daemon_.root());
    ASSERT_TRUE(client) << "connection " << i;
    held.push_back(std::move(*client));
  }
  QRVClientError error;
  std::optional<QRVClient> extra = QRVClient::connect(daemon_.root(), &error);
  ASSERT_TRUE(extra) << error.message;     // the kernel's backlog takes it ...
  EXPECT_TRUE(closedByPeer(extra->fd()));  // ... the daemon closes it at once
  EXPECT_TRUE(daemon_.logEventuallyContains("the limit of 4 open connections is reached"));

  // The connections within the bound are unaffected.
  for (QRVClient& client : held) EXPECT_TRUE(served(client));
  // Once one leaves, a new one gets its slot.
  held.pop_back();
  EXPECT_TRUE(servedConnection(daemon_.root()));
  EXPECT_TRUE(daemon_.isRunning());
}

}  // namespace

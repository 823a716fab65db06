// Memory a burst of large requests leaves behind once the daemon is idle.
#include <gtest/gtest.h>
#include <unistd.h>

#include <fstream>
#include <optional>
#include <string>
#include <vector>

#include "client/QRVClient.h"
#include "integration/QRVDaemonProcess.h"
#include "support/QRVEventually.h"
#include "support/QRVRequests.h"

namespace {

// Resident memory of `pid` in kB (0 when unreadable).
long residentKB(pid_t pid) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  for (std::string line; std::getline(status, line);)
    if (line.rfind("VmRSS:", 0) == 0) return std::stol(line.substr(6));
  return 0;
}

TEST(DaemonMemoryTest, BurstOfLargeRequestsIsGivenBackOnceIdle) {
  if (geteuid() != 0) GTEST_SKIP() << "the daemon runs as root";
#ifdef QUORVAD_SANITIZED
  GTEST_SKIP() << "the sanitizer's allocator keeps freed memory on purpose";
#endif
  QRVDaemonProcess daemon;
  daemon.start();
  ASSERT_TRUE(daemon.isRunning());
  const long idleBefore = residentKB(daemon.pid());
  ASSERT_GT(idleBefore, 0);

  // Sixteen clients at once, each with an 8 MB string in its request. The
  // daemon reads and parses each before it answers (here: not entitled).
  const QRVPlist request = QRVRequest(32).set("Padding", QRVPlist::string(std::string(8'000'000, 'x')));
  std::vector<QRVClient> clients;
  QRVClientError error;
  for (int i = 0; i < 16; i++) {
    std::optional<QRVClient> client = QRVClient::connect(daemon.root(), &error);
    ASSERT_TRUE(client) << error.message;
    clients.push_back(std::move(*client));
  }
  for (QRVClient& client : clients)
    ASSERT_TRUE(client.sendRequest(request, std::chrono::seconds(30), &error)) << error.message;
  clients.clear();

  // Before, the allocator kept some 90 MB of it; a few MB of slack remain.
  constexpr long kAllowedGrowthKB = 32 * 1024;
  EXPECT_TRUE(QRVEventually([&] { return residentKB(daemon.pid()) < idleBefore + kAllowedGrowthKB; }))
      << "idle before: " << idleBefore << " kB, now: " << residentKB(daemon.pid()) << " kB";
}

}  // namespace

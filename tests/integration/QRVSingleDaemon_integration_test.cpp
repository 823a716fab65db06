// One daemon per root: a second one started on a root that is being served
// leaves, without touching the first one's socket or state.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <optional>
#include <string>
#include <thread>

#include "client/QRVClient.h"
#include "integration/QRVDaemonProcess.h"
#include "support/QRVRequests.h"

namespace {

struct Outcome {
  std::optional<int> status;  // wait status; nothing when it did not exit in time
  std::string standardError;
};

// Runs another quorvad on `root` and collects what it wrote on stderr. With
// `activatedSocket`, the socket is handed over as systemd would.
Outcome runSecondDaemon(const std::string& root, int activatedSocket = -1) {
  int errPipe[2];
  if (pipe2(errPipe, O_CLOEXEC) != 0) return {};
  pid_t pid = fork();
  if (pid == 0) {
    dup2(errPipe[1], STDERR_FILENO);
    if (activatedSocket >= 0) {
      dup2(activatedSocket, 3);  // dup2 leaves close-on-exec off
      setenv("LISTEN_FDS", "1", 1);
      setenv("LISTEN_FDNAMES", "com.kelva.quorvad", 1);
      setenv("LISTEN_PID", std::to_string(getpid()).c_str(), 1);
    }
    setenv("ASAN_OPTIONS", "detect_leaks=0", 0);
    unsetenv("JOURNAL_STREAM");
    execl(QUORVAD_BINARY, QUORVAD_BINARY, "--root", root.c_str(), static_cast<char*>(nullptr));
    _exit(127);
  }
  close(errPipe[1]);
  Outcome outcome;
  auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  char buffer[4096];
  for (;;) {
    pollfd p{errPipe[0], POLLIN, 0};
    int left = static_cast<int>(
        std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now()).count());
    if (left <= 0 || poll(&p, 1, left) <= 0) break;
    ssize_t n = read(errPipe[0], buffer, sizeof buffer);
    if (n <= 0) break;  // end of file: the daemon is gone
    outcome.standardError.append(buffer, static_cast<size_t>(n));
  }
  close(errPipe[0]);
  while (std::chrono::steady_clock::now() < deadline) {
    int status = 0;
    if (waitpid(pid, &status, WNOHANG) == pid) {
      outcome.status = status;
      return outcome;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  kill(pid, SIGKILL);
  waitpid(pid, nullptr, 0);
  return outcome;
}

ino_t inodeOf(const std::string& path) {
  struct stat st {};
  return stat(path.c_str(), &st) == 0 ? st.st_ino : 0;
}

uint64_t ping(const std::string& root) {
  QRVClientError error;
  auto client = QRVClient::connect(root, &error);
  auto reply = client ? client->sendRequest(QRVRequest(32), std::chrono::seconds(5), &error) : std::nullopt;
  return reply ? QRVClient::resultCode(*reply) : 0;
}

class SingleDaemonTest : public testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "the daemon runs as root";
    daemon_.start();
    ASSERT_TRUE(daemon_.isRunning());
    answer_ = ping(daemon_.root());
    ASSERT_NE(answer_, 0u);
  }

  QRVDaemonProcess daemon_;
  uint64_t answer_ = 0;
};

TEST_F(SingleDaemonTest, SecondDaemonOnTheSameRootExitsAndLeavesTheFirstServing) {
  const ino_t socketBefore = inodeOf(daemon_.socketPath());
  ASSERT_NE(socketBefore, 0u);

  Outcome second = runSecondDaemon(daemon_.root());
  ASSERT_TRUE(second.status) << "the second daemon did not exit";
  ASSERT_TRUE(WIFEXITED(*second.status));
  EXPECT_EQ(WEXITSTATUS(*second.status), 1);
  EXPECT_NE(second.standardError.find("another quorvad already runs on this root"), std::string::npos)
      << second.standardError;
  EXPECT_NE(second.standardError.find(daemon_.root() + "/run/quorvad/quorvad.lock"), std::string::npos);

  // The socket is still the first daemon's, and it still answers.
  EXPECT_EQ(inodeOf(daemon_.socketPath()), socketBefore);
  EXPECT_TRUE(daemon_.isRunning());
  EXPECT_EQ(ping(daemon_.root()), answer_);
}

TEST_F(SingleDaemonTest, SecondDaemonDoesNotAcceptOnAHandedOverSocket) {
  // A socket as systemd would pass it, with a client already waiting on it.
  std::string path = daemon_.root() + "/run/activated.sock";
  int listener = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
  ASSERT_EQ(bind(listener, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
  ASSERT_EQ(listen(listener, 8), 0);
  int waiting = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  ASSERT_EQ(connect(waiting, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);

  Outcome second = runSecondDaemon(daemon_.root(), listener);
  ASSERT_TRUE(second.status) << "the second daemon did not exit";
  ASSERT_TRUE(WIFEXITED(*second.status));
  EXPECT_EQ(WEXITSTATUS(*second.status), 1);
  EXPECT_NE(second.standardError.find("another quorvad already runs on this root"), std::string::npos)
      << second.standardError;

  // The waiting client was never taken off the backlog.
  int pending = accept4(listener, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
  EXPECT_GE(pending, 0) << "the second daemon accepted the waiting connection";
  if (pending >= 0) close(pending);
  close(waiting);
  close(listener);
  EXPECT_EQ(ping(daemon_.root()), answer_);
}

TEST_F(SingleDaemonTest, TheRootIsFreeAgainOnceTheFirstDaemonHasGone) {
  daemon_.stop();
  // A daemon killed outright leaves no claim behind either: the kernel drops
  // the lock with the process.
  daemon_.start();
  ASSERT_TRUE(daemon_.isRunning());
  kill(daemon_.pid(), SIGKILL);
  ASSERT_TRUE(daemon_.waitForExit(std::chrono::seconds(5)));
  daemon_.start();
  EXPECT_TRUE(daemon_.isRunning());
  EXPECT_EQ(ping(daemon_.root()), answer_);
}

}  // namespace

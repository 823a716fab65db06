// Requests are attributed to the right client: by executable, by uid, and
// the installer's identity is rebuilt when its process restarts. A
// connection keeps its peer's identity between requests only while the peer
// stays what it was: an exec, a confinement or a trust-store change shows at
// the very next request on the same connection.
#include <gtest/gtest.h>

#include <linux/filter.h>
#include <linux/seccomp.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <regex>
#include <thread>

#include "client/QRVClient.h"
#include "integration/QRVDaemonProcess.h"
#include "integration/QRVRunAs.h"
#include "support/QRVRequests.h"

namespace {

std::string selfExecutable() {
  char buf[4096];
  ssize_t n = readlink("/proc/self/exe", buf, sizeof buf - 1);
  return n > 0 ? std::string(buf, static_cast<size_t>(n)) : std::string();
}

// One capture per identity logged for `identifier` (one per request):
// `field` is a pattern with one group, matched after the identity's opening.
std::vector<std::string> loggedIdentityField(const std::string& log, const std::string& identifier,
                                             const std::string& field) {
  std::vector<std::string> out;
  std::regex line("\\[" + identifier + "\\] Relay client identity: <QRVClientIdentity: " + field);
  for (auto it = std::sregex_iterator(log.begin(), log.end(), line); it != std::sregex_iterator(); ++it)
    out.push_back((*it)[1]);
  return out;
}

// The addresses of the identities logged for `identifier`.
std::vector<std::string> loggedIdentities(const std::string& log, const std::string& identifier) {
  return loggedIdentityField(log, identifier, "(0x[0-9a-f]+);");
}

// The "isSandboxed" field of each identity logged for `identifier`.
std::vector<std::string> loggedSandboxFlags(const std::string& log, const std::string& identifier) {
  return loggedIdentityField(log, identifier, "[^\n]*isSandboxed = ([01])");
}

// A peer process that connects to the daemon under `uid` and then runs
// `afterConnect` (which may exec). The test keeps its own descriptor of the
// same socket, so it speaks on the peer's connection: the daemon attributes
// what it reads there to the process that connected.
class ConnectedPeer {
 public:
  ConnectedPeer(const QRVDaemonProcess& daemon, uid_t uid, const std::function<void()>& afterConnect) {
    fd_ = socket(AF_UNIX, SOCK_STREAM, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::string path = daemon.socketPath();
    memcpy(address.sun_path, path.c_str(), path.size() + 1);
    int connected[2];
    if (fd_ < 0 || pipe(connected) != 0) return;
    pid_ = fork();
    if (pid_ == 0) {
      close(connected[0]);
      if (setgid(uid) != 0 || setuid(uid) != 0 ||
          connect(fd_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0)
        _exit(1);
      if (write(connected[1], "c", 1) != 1) _exit(1);
      close(connected[1]);
      afterConnect();
      _exit(0);
    }
    close(connected[1]);
    char c;
    bool ok = pid_ > 0 && read(connected[0], &c, 1) == 1;
    close(connected[0]);
    if (ok) client_.emplace(QRVClient::adoptSocket(fd_));
    fd_ = -1;
  }
  ~ConnectedPeer() {
    client_.reset();
    if (fd_ >= 0) close(fd_);
    if (pid_ > 0) {
      kill(pid_, SIGKILL);
      waitpid(pid_, nullptr, 0);
    }
  }

  pid_t pid() const { return pid_; }
  uint64_t resultOf(const QRVPlist& request) {
    if (!client_) return 0;
    QRVClientError error;
    std::optional<QRVPlist> reply = client_->sendRequest(request, std::chrono::seconds(10), &error);
    return reply ? QRVClient::resultCode(*reply) : 0;
  }
  // Waits until the peer runs the executable at `path`.
  bool eventuallyRuns(const std::string& path) {
    struct stat want;
    if (stat(path.c_str(), &want) != 0) return false;
    std::string exe = "/proc/" + std::to_string(pid_) + "/exe";
    for (int i = 0; i < 500; i++) {
      struct stat running;
      if (stat(exe.c_str(), &running) == 0 && running.st_dev == want.st_dev && running.st_ino == want.st_ino)
        return true;
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
  }

 private:
  int fd_ = -1;
  pid_t pid_ = -1;
  std::optional<QRVClient> client_;
};

QRVPlist testabilityEntitlements(bool granted) {
  QRVPlist e = QRVPlist::dictionary();
  if (granted) e.set("com.kelva.private.Quorva.testability", QRVPlist::boolean(true));
  return e;
}

QRVPlist executableEntry(const std::string& identifier, const std::string& executable, uid_t uid, bool granted) {
  return QRVPlist::dictionary()
      .set("SigningIdentifier", QRVPlist::string(identifier))
      .set("Executable", QRVPlist::string(executable))
      .set("UID", QRVPlist::uinteger(uid))
      .set("Entitlements", testabilityEntitlements(granted));
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
  auto testCodeAs = [&](uid_t uid) { return QRVClient::resultCode(QRVRepliesAs(daemon_, uid, {QRVRequest(25)})[0]); };
  EXPECT_EQ(testCodeAs(3001), 1u);
  EXPECT_EQ(testCodeAs(3002), 55u);
  EXPECT_EQ(testCodeAs(3003), 55u);
  std::string log = daemon_.readLog();
  EXPECT_EQ(loggedIdentities(log, "com.example.tool").size(), 1u);
  EXPECT_EQ(loggedIdentities(log, "com.example.byuid").size(), 1u);
  EXPECT_TRUE(loggedIdentities(log, "com.example.ghost").empty());
  EXPECT_NE(log.find("command=25, client=com.example.tool, error=1"), std::string::npos);

  // The trust store is re-read when it changes.
  daemon_.trustUID(3003, "com.example.late",
                   QRVPlist::dictionary().set("com.kelva.private.Quorva.testability", QRVPlist::boolean(true)));
  EXPECT_EQ(testCodeAs(3003), 1u);
}

TEST_F(ClientIdentityIntegrationTest, RestartedInstallerGetsAFreshIdentity) {
  daemon_.trustUID(3010, "com.kelva.verdaned",
                   QRVPlist::dictionary().set("com.kelva.private.Quorva.allowed", QRVPlist::boolean(true)));
  daemon_.start();
  // One process asks three times, then a new process twice.
  for (size_t count : {3, 2})
    for (const QRVPlist& reply : QRVRepliesAs(daemon_, 3010, std::vector<QRVPlist>(count, QRVRequest(32))))
      EXPECT_EQ(QRVClient::resultCode(reply), 49u);
  std::vector<std::string> ids = loggedIdentities(daemon_.readLog(), "com.kelva.verdaned");
  ASSERT_EQ(ids.size(), 5u);
  // The first process's requests share one identity; the restarted process
  // has another.
  EXPECT_EQ(ids[0], ids[1]);
  EXPECT_EQ(ids[1], ids[2]);
  EXPECT_EQ(ids[3], ids[4]);
  EXPECT_NE(ids[2], ids[3]);
}

TEST_F(ClientIdentityIntegrationTest, AConnectedPeerIsIdentifiedAnewWhenItExecsOrTheTrustStoreChanges) {
  char* shell = realpath("/bin/sh", nullptr);
  char* sleeper = realpath("/bin/sleep", nullptr);
  ASSERT_TRUE(shell && sleeper);
  const std::string shellPath = shell, sleeperPath = sleeper;
  free(shell);
  free(sleeper);
  daemon_.trustEntry("shell", executableEntry("com.example.shell", shellPath, 3020, true));
  daemon_.trustEntry("sleeper", executableEntry("com.example.sleeper", sleeperPath, 3020, false));
  daemon_.start();

  // The peer connects, then runs a shell that waits for a line on its input
  // and then execs another program, on the same connection.
  int line[2];
  ASSERT_EQ(pipe(line), 0);
  ConnectedPeer peer(daemon_, 3020, [&] {
    dup2(line[0], STDIN_FILENO);
    close(line[1]);
    execl(shellPath.c_str(), "sh", "-c", "read x; exec sleep 60", static_cast<char*>(nullptr));
  });
  close(line[0]);
  ASSERT_TRUE(peer.eventuallyRuns(shellPath));
  EXPECT_EQ(peer.resultOf(QRVRequest(25)), 1u);
  EXPECT_EQ(peer.resultOf(QRVRequest(25)), 1u);
  // An unchanged peer keeps its identity between requests.
  std::vector<std::string> shellIdentities = loggedIdentities(daemon_.readLog(), "com.example.shell");
  ASSERT_EQ(shellIdentities.size(), 2u);
  EXPECT_EQ(shellIdentities[0], shellIdentities[1]);

  ASSERT_EQ(write(line[1], "go\n", 3), 3);
  close(line[1]);
  ASSERT_TRUE(peer.eventuallyRuns(sleeperPath));
  EXPECT_EQ(peer.resultOf(QRVRequest(25)), 55u);
  EXPECT_EQ(loggedIdentities(daemon_.readLog(), "com.example.sleeper").size(), 1u);

  // A trust-store change reaches a connection that is already open.
  daemon_.trustEntry("sleeper", executableEntry("com.example.sleeper", sleeperPath, 3020, true));
  EXPECT_EQ(peer.resultOf(QRVRequest(25)), 1u);
  daemon_.trustEntry("sleeper", executableEntry("com.example.sleeper", sleeperPath, 3020, false));
  EXPECT_EQ(peer.resultOf(QRVRequest(25)), 55u);
}

TEST_F(ClientIdentityIntegrationTest, APeerThatConfinesItselfAfterConnectingShowsSandboxed) {
  daemon_.trustEntry("self", executableEntry("com.example.confining", selfExecutable(), 3021, true));
  daemon_.start();
  int go[2], done[2];
  ASSERT_EQ(pipe(go), 0);
  ASSERT_EQ(pipe(done), 0);
  ConnectedPeer peer(daemon_, 3021, [&] {
    char c;
    if (read(go[0], &c, 1) != 1) _exit(1);
    // What a sandbox does to a process: no new privileges and a seccomp
    // filter (this one allows everything).
    sock_filter allow = BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW);
    sock_fprog program{1, &allow};
    if (prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0 || prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program) != 0)
      _exit(1);
    if (write(done[1], "d", 1) != 1) _exit(1);
    pause();
  });
  close(go[0]);
  close(done[1]);
  EXPECT_EQ(peer.resultOf(QRVRequest(25)), 1u);
  ASSERT_EQ(write(go[1], "g", 1), 1);
  char c;
  ASSERT_EQ(read(done[0], &c, 1), 1);
  EXPECT_EQ(peer.resultOf(QRVRequest(25)), 1u);
  EXPECT_EQ(peer.resultOf(QRVRequest(25)), 1u);
  close(go[1]);
  close(done[0]);
  EXPECT_EQ(loggedSandboxFlags(daemon_.readLog(), "com.example.confining"),
            (std::vector<std::string>{"0", "1", "1"}));
}

}  // namespace

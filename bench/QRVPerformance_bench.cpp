// Every performance figure of the daemon beside its raw baseline, from one run.
//
// The real quorvad binary runs as a separate process on a temporary root
// (made like the integration tests' roots, on the file system of --dir), and
// this program is its client through the client library. Each figure is set
// beside the same work done raw, measured in the same run: the repetitions
// alternate daemon, raw, daemon, raw, ... and the table shows the medians of
// the repetitions.
//
//  - look-up latency: command 0 (create-or-lookup) of an existing container,
//    one client, p50/p99; raw: a Unix stream server in this process, with the
//    daemon's framing, decoding the request, a hash-map look-up and the
//    encoding of a reply dictionary that is the daemon's own reply to the
//    same request (so the same size).
//  - look-ups per second with 1, 2, 8 and 64 clients, each its own thread
//    and connection; raw: the same server, kDaemonWorkerThreads workers on
//    one epoll set, each connection owned by one worker at a time (as the
//    daemon's message service serves them).
//  - the look-up rows again against the same server doing, per request, what
//    a look-up must do beyond that (re-reading the peer, the metadata file's
//    stat, a sealed sandbox token), with the daemon's own platform code: the
//    daemon's cost over this is its own overhead.
//  - durable creations per second: new containers through the daemon; raw:
//    the directories, files, fsyncs and renames the daemon makes for one
//    creation, as system calls on the same file system; and again with the
//    daemon's own, safer, sequence of system calls.
//  - first answer after a start on a root of kStartContainers containers of
//    one class: from spawn to the first answered look-up (which builds the
//    class map), warm and cold page cache; raw: reading and decoding every
//    metadata file, one thread warm, kColdReadThreads threads cold. The
//    start-up alone (spawn to the first answer that needs no class map) is
//    shown beside it.
//  - disk usage of a container of kUsageFiles files: command 23; raw:
//    `du -sB1` on the same directory.
//
//   QRVPerformance_bench [--dir DIR] [--quick] [--repetitions N] [--only ROWS]
//     --dir DIR          where the temporary root goes (default $TMPDIR or
//                        /tmp); the figures are those of its file system
//     --quick            small sizes and few requests: checks that every
//                        part runs, in well under a minute
//     --repetitions N    rounds of each side (default 5; at least 5 outside
//                        --quick)
//     --only ROWS        one group of rows: lookups, creations, usage or
//                        first (the first answer after a start)
//
// Needs root (the daemon changes owners, the raw side does the same).
#include <dirent.h>
#include <fcntl.h>
#include <fmt/format.h>
#include <pthread.h>
#include <signal.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysinfo.h>
#include <sys/un.h>
#include <sys/utsname.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

#include "QRVBenchTiming.h"
#include "base/QRVPlist.h"
#include "base/QRVUUID.h"
#include "base/QRVWireFrame.h"
#include "client/QRVContainerClient.h"
#include "integration/QRVDaemonProcess.h"
#include "platform/linux/QRVLinuxSandbox.h"
#include "platform/linux/QRVPeerProcess.h"

namespace {

using QRVBench::Clock;
using QRVBench::millisSince;

// The daemon's message service serves connections with this many workers
// (QRVLinuxMessageService::Options::workerThreads); the raw server does too.
constexpr size_t kDaemonWorkerThreads = 4;
// The raw cold read goes at the parallelism a rebuild of the cache may use
// from a cold disk.
constexpr size_t kColdReadThreads = 8;
// The class every container of the bench is made in: application data.
constexpr uint64_t kDataClass = 2;
constexpr const char* kMetadataFileName = ".com.kelva.quorva.metadata.plist";
constexpr const char* kMetadataIdentifierKey = "QRVMetadataIdentifier";
constexpr auto kTimeout = std::chrono::seconds(120);

struct Sizes {
  int repetitions = 5;
  int lookupContainers = 64;      // what the look-up rows ask for
  int latencyRequests = 2000;     // per repetition and side
  int throughputRequests = 4000;  // per repetition, side and client count
  int creations = 40;             // per repetition and side
  int startContainers = 10'000;   // the root of the first-answer rows
  int usageFiles = 100'000;       // the container of the disk-usage row
};

Sizes quickSizes() {
  Sizes s;
  s.repetitions = 2;
  s.lookupContainers = 8;
  s.latencyRequests = 200;
  s.throughputRequests = 256;
  s.creations = 5;
  s.startContainers = 200;
  s.usageFiles = 2000;
  return s;
}

[[noreturn]] void fail(const std::string& what) { throw std::runtime_error(what); }

std::string identifierFor(const char* kind, int i) { return fmt::format("com.example.bench.{}{}", kind, i); }

QRVPlist lookupRequest(const std::string& identifier) {
  return QRVContainerRequests::createOrLookupContainer(
      {.identifier = identifier, .containerClass = kDataClass, .persona = std::nullopt, .uuid = std::nullopt},
      /*create=*/true, /*transient=*/false);
}

// ---- Clean-up on every exit path ----
//
// Returns and exceptions unwind through the destructors below. A signal
// (Ctrl-C, a timeout's SIGTERM) is taken by a thread of its own, which kills
// the daemon and removes the root before the process ends. The daemon also
// dies with this process's main thread (PR_SET_PDEATHSIG), even on SIGKILL.

std::atomic<pid_t> gDaemonPid{-1};
std::atomic<bool> gStopping{false};  // no daemon is started once set
std::mutex gRootMutex;
std::string gRootToRemove;

void startSignalWatcher() {
  sigset_t set;
  sigemptyset(&set);
  for (int s : {SIGINT, SIGTERM, SIGHUP, SIGQUIT}) sigaddset(&set, s);
  // Blocked before any other thread exists, so every thread inherits it and
  // only the watcher receives them.
  pthread_sigmask(SIG_BLOCK, &set, nullptr);
  std::thread([set] {
    int signal = 0;
    sigwait(&set, &signal);
    gStopping = true;
    fprintf(stderr, "\nsignal %d: stopping the daemon and removing the temporary root\n", signal);
    if (pid_t pid = gDaemonPid.exchange(-1); pid > 0) {
      kill(pid, SIGKILL);
      waitpid(pid, nullptr, 0);
    }
    std::lock_guard<std::mutex> lock(gRootMutex);
    // The main thread may still be writing into the root (or removing it
    // itself, after its daemon vanished): go on until it is gone.
    for (int attempt = 0; attempt < 50 && !gRootToRemove.empty(); attempt++) {
      std::error_code ec;
      std::filesystem::remove_all(gRootToRemove, ec);
      if (!std::filesystem::exists(gRootToRemove, ec)) break;
      usleep(20'000);
    }
    _exit(128 + signal);
  }).detach();
}

// ---- The daemon ----

std::string tailOf(const std::string& path) {
  FILE* f = fopen(path.c_str(), "r");
  if (!f) return "(nothing)";
  std::string text;
  char buffer[4096];
  for (size_t n; (n = fread(buffer, 1, sizeof buffer, f)) > 0;) text.append(buffer, n);
  fclose(f);
  return text.size() > 2000 ? text.substr(text.size() - 2000) : text;
}

// The temporary root, prepared as the integration tests prepare theirs, with
// a trust-store entry that makes this process (root) an unrestricted client.
class BenchRoot {
 public:
  BenchRoot() : daemon_(std::make_unique<QRVDaemonProcess>()) {
    daemon_->trustUID(getuid(), "com.example.bench.client",
                      QRVPlist::dictionary().set("com.kelva.private.Quorva.allowed", QRVPlist::boolean(true)));
    std::lock_guard<std::mutex> lock(gRootMutex);
    gRootToRemove = daemon_->root();
  }
  // Removes the root under the lock, so that a signal meanwhile waits for
  // the removal instead of ending the process half-way through it.
  ~BenchRoot() {
    std::lock_guard<std::mutex> lock(gRootMutex);
    daemon_.reset();
    gRootToRemove.clear();
  }
  const std::string& path() const { return daemon_->root(); }
  std::string socketPath() const { return daemon_->socketPath(); }

 private:
  std::unique_ptr<QRVDaemonProcess> daemon_;  // its destructor removes the root
};

// One run of the daemon binary: spawned by the constructor, stopped by the
// destructor.
class DaemonRun {
 public:
  explicit DaemonRun(const BenchRoot& root)
      : socketPath_(root.socketPath()), stderrPath_(root.path() + "/daemon-stderr.log"), spawned_(Clock::now()) {
    std::vector<std::string> args = {QUORVAD_BINARY, "--root", root.path()};
    if (gStopping) fail("stopping");
    pid_ = fork();
    if (pid_ < 0) fail("fork failed");
    if (pid_ == 0) {
      prctl(PR_SET_PDEATHSIG, SIGKILL);
      sigset_t none;
      sigemptyset(&none);
      pthread_sigmask(SIG_SETMASK, &none, nullptr);
      std::vector<char*> argv;
      for (auto& a : args) argv.push_back(a.data());
      argv.push_back(nullptr);
      setenv("ASAN_OPTIONS", "detect_leaks=0", 0);
      // What it says before its log is open would interleave with the table.
      int err = open(stderrPath_.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
      if (err >= 0) dup2(err, STDERR_FILENO);
      execv(argv[0], argv.data());
      _exit(127);
    }
    gDaemonPid = pid_;
  }
  ~DaemonRun() { stop(); }
  DaemonRun(const DaemonRun&) = delete;
  DaemonRun& operator=(const DaemonRun&) = delete;

  Clock::time_point spawned() const { return spawned_; }

  // A connection, once the daemon answers a request that needs no state
  // (an unknown command: it is answered as soon as start-up has run).
  QRVContainerClient firstAnswer() {
    auto deadline = Clock::now() + kTimeout;
    while (Clock::now() < deadline) {
      QRVClientError error;
      if (auto client = QRVClient::connectToSocket(socketPath_, &error)) {
        if (client->sendRequest(QRVContainerRequests::command(32), kTimeout, &error))
          return QRVContainerClient(std::move(*client), kTimeout);
      }
      if (int status = 0; waitpid(pid_, &status, WNOHANG) == pid_) {
        gDaemonPid = -1;
        pid_ = -1;
        fail("the daemon died in start-up; it said:\n" + tailOf(stderrPath_));
      }
      usleep(200);
    }
    fail("the daemon did not answer");
  }

  void stop() {
    if (pid_ <= 0) return;
    kill(pid_, SIGTERM);
    for (int i = 0; i < 2000; i++) {
      if (waitpid(pid_, nullptr, WNOHANG) == pid_) {
        pid_ = -1;
        break;
      }
      usleep(5000);
    }
    if (pid_ > 0) {
      kill(pid_, SIGKILL);
      waitpid(pid_, nullptr, 0);
      pid_ = -1;
    }
    gDaemonPid = -1;
  }

 private:
  std::string socketPath_;
  std::string stderrPath_;
  Clock::time_point spawned_;
  pid_t pid_ = -1;
};

QRVContainerClient connectTo(const std::string& socketPath) {
  QRVClientError error;
  auto client = QRVClient::connectToSocket(socketPath, &error);
  if (!client) fail("cannot connect to " + socketPath + ": " + error.message);
  return QRVContainerClient(std::move(*client), kTimeout);
}

QRVContainerResult call(QRVContainerClient& client, const QRVPlist& request) {
  QRVClientError error;
  auto result = client.call(request, &error);
  if (!result) fail("no reply: " + error.message);
  if (!result->ok()) fail("request failed: " + result->reply.description());
  return *result;
}

// ---- The raw look-up server ----

// What the daemon's message service does for a request, minus the daemon:
// the same framing and decoding, a hash-map look-up of the identifier, and
// the encoding and sending of a stored reply. kDaemonWorkerThreads workers
// share one epoll set; a connection is armed one-shot, so one worker at a
// time reads it and answers on its own thread, as in the daemon.
//
// With `checks`, each request also pays what a look-up must do beyond that,
// with the daemon's own platform code: the peer re-read on the descriptors
// kept since accept (a peer may exec or enter a sandbox between requests),
// the stat of the container's metadata file (a container removed behind the
// daemon's back is not handed out), and a freshly sealed sandbox token in
// the reply. The daemon's cost over this server is its own overhead.
class RawLookupServer {
 public:
  struct Checks {
    std::string keyPath;  // the sealing key of the server's own tokens
  };

  RawLookupServer(std::string path, std::unordered_map<std::string, QRVPlist> replies,
                  std::optional<Checks> checks = std::nullopt)
      : path_(std::move(path)), replies_(std::move(replies)) {
    if (checks) {
      sandbox_ = std::make_unique<QRVLinuxSandbox>(QRVLinuxSandbox::Options{
          .keyPath = checks->keyPath, .registryPath = checks->keyPath + ".registry", .registryQueue = nullptr});
      for (const auto& [identifier, reply] : replies_)
        metadataPaths_[identifier] = reply.stringForKey("ReplyPath") + "/" + kMetadataFileName;
    }
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    snprintf(address.sun_path, sizeof address.sun_path, "%s", path_.c_str());
    unlink(path_.c_str());
    listenFd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (listenFd_ < 0 || bind(listenFd_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
        listen(listenFd_, SOMAXCONN) != 0)
      fail("raw server: cannot listen on " + path_);
    epollFd_ = epoll_create1(EPOLL_CLOEXEC);
    wakeFd_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    watch(listenFd_, &listenFd_, EPOLL_CTL_ADD, EPOLLIN | EPOLLONESHOT);
    watch(wakeFd_, &wakeFd_, EPOLL_CTL_ADD, EPOLLIN);  // level: wakes every worker
    for (size_t i = 0; i < kDaemonWorkerThreads; i++) workers_.emplace_back([this] { workerLoop(); });
  }

  ~RawLookupServer() {
    uint64_t one = 1;
    if (write(wakeFd_, &one, sizeof one) < 0) perror("raw server: eventfd");
    for (auto& t : workers_) t.join();
    for (auto& c : connections_) close(c->fd);
    close(listenFd_);
    close(epollFd_);
    close(wakeFd_);
    unlink(path_.c_str());
  }

  const std::string& path() const { return path_; }

 private:
  struct Connection {
    int fd;
    std::vector<uint8_t> in;
    std::unique_ptr<QRVPeerProcess> peer;  // with checks
    QRVAuditToken token;
  };

  void watch(int fd, void* tag, int op, uint32_t events) {
    epoll_event ev{};
    ev.events = events;
    ev.data.ptr = tag;
    if (epoll_ctl(epollFd_, op, fd, &ev) != 0) fail("raw server: epoll_ctl");
  }

  void workerLoop() {
    for (;;) {
      epoll_event ev;
      int n = epoll_wait(epollFd_, &ev, 1, -1);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0 || ev.data.ptr == &wakeFd_) return;
      if (ev.data.ptr == &listenFd_) {
        acceptAll();
        continue;
      }
      auto* c = static_cast<Connection*>(ev.data.ptr);
      if (serve(c)) {
        watch(c->fd, c, EPOLL_CTL_MOD, EPOLLIN | EPOLLONESHOT);
      } else {
        epoll_ctl(epollFd_, EPOLL_CTL_DEL, c->fd, nullptr);
        forget(c);
      }
    }
  }

  void acceptAll() {
    for (;;) {
      int fd = accept4(listenFd_, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
      if (fd < 0) break;
      auto c = std::make_unique<Connection>(Connection{fd, {}, nullptr, {}});
      if (sandbox_) {
        ucred cred{};
        socklen_t length = sizeof cred;
        if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &length) != 0) fail("raw server: SO_PEERCRED");
        int pidfd = static_cast<int>(syscall(SYS_pidfd_open, cred.pid, 0));
        c->peer = std::make_unique<QRVPeerProcess>(cred.pid, pidfd);
        c->token = QRVAuditToken::make(cred.uid, cred.gid, cred.pid, 0);
      }
      Connection* raw = c.get();
      {
        std::lock_guard<std::mutex> lock(mutex_);
        connections_.push_back(std::move(c));
      }
      watch(fd, raw, EPOLL_CTL_ADD, EPOLLIN | EPOLLONESHOT);
    }
    watch(listenFd_, &listenFd_, EPOLL_CTL_MOD, EPOLLIN | EPOLLONESHOT);
  }

  void forget(Connection* c) {
    std::lock_guard<std::mutex> lock(mutex_);
    close(c->fd);
    std::erase_if(connections_, [c](const auto& p) { return p.get() == c; });
  }

  // Reads what the socket has and answers every whole frame. False when the
  // peer has gone.
  bool serve(Connection* c) {
    for (;;) {
      size_t old = c->in.size();
      c->in.resize(old + 64 * 1024);
      ssize_t n = recv(c->fd, c->in.data() + old, 64 * 1024, 0);
      c->in.resize(old + (n > 0 ? static_cast<size_t>(n) : 0));
      if (n == 0) return false;
      if (n < 0) return errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR;
      size_t offset = 0;
      while (c->in.size() - offset >= QRVWireFrame::kHeaderSize) {
        QRVWireFrame::Header h = QRVWireFrame::decodeHeader(c->in.data() + offset);
        if (c->in.size() - offset < QRVWireFrame::kHeaderSize + h.length) break;
        auto body = QRVWireFrame::decodeBody(c->in.data() + offset + QRVWireFrame::kHeaderSize, h.length);
        offset += QRVWireFrame::kHeaderSize + h.length;
        if (!body || !answer(*c, *body, h.messageId)) return false;
      }
      c->in.erase(c->in.begin(), c->in.begin() + static_cast<ptrdiff_t>(offset));
    }
  }

  bool answer(Connection& c, const QRVPlist& request, uint64_t messageId) {
    const int fd = c.fd;
    auto it = replies_.find(request.stringForKey("Identifier"));
    QRVPlist notFound = QRVPlist::dictionary().set("ReplyError", QRVPlist::uinteger(21));
    std::vector<uint8_t> frame;
    if (it != replies_.end() && sandbox_) {
      if (!c.peer->state()) return false;
      struct stat st;
      if (stat(metadataPaths_.at(it->first).c_str(), &st) != 0) fail("raw server: the metadata file has gone");
      QRVPlist reply = it->second;
      auto token = sandbox_->issueExtension("com.kelva.sandbox.container", reply.stringForKey("ReplyPath"),
                                            c.token, nullptr);
      if (!token) fail("raw server: no sandbox token");
      reply.set("SandboxToken", QRVPlist::string(std::move(*token)));
      frame = QRVWireFrame::encode(reply, 0, messageId);
    } else {
      frame = QRVWireFrame::encode(it == replies_.end() ? notFound : it->second, 0, messageId);
    }
    for (size_t sent = 0; sent < frame.size();) {
      ssize_t n = send(fd, frame.data() + sent, frame.size() - sent, MSG_NOSIGNAL);
      if (n < 0 && (errno == EINTR || errno == EAGAIN)) continue;
      if (n <= 0) return false;
      sent += static_cast<size_t>(n);
    }
    return true;
  }

  const std::string path_;
  const std::unordered_map<std::string, QRVPlist> replies_;
  std::unique_ptr<QRVLinuxSandbox> sandbox_;  // with checks
  std::unordered_map<std::string, std::string> metadataPaths_;
  int listenFd_ = -1;
  int epollFd_ = -1;
  int wakeFd_ = -1;
  std::vector<std::thread> workers_;
  std::mutex mutex_;
  std::vector<std::unique_ptr<Connection>> connections_;
};

// ---- The table ----

struct Row {
  std::string figure;
  std::string unit;
  double daemon;
  double raw;
  bool higherIsBetter;  // a rate: the cost ratio is raw / daemon
  std::string note;
};

// A row without a raw side (kNoRaw) shows the daemon's figure alone.
constexpr double kNoRaw = -1;

std::vector<Row> gRows;
std::vector<std::string> gNotes;

void addRow(std::string figure, std::string unit, double daemon, double raw, bool rate, std::string note = "") {
  gRows.push_back({std::move(figure), std::move(unit), daemon, raw, rate, std::move(note)});
  const Row& r = gRows.back();
  fprintf(stderr, "  %s: daemon %.1f %s, raw %.1f %s\n", r.figure.c_str(), r.daemon, r.unit.c_str(),
          r.raw == kNoRaw ? 0.0 : r.raw, r.unit.c_str());
}

void printTable() {
  printf("\n| figure | daemon | raw baseline | daemon cost / raw cost |\n|---|---|---|---|\n");
  for (const Row& r : gRows) {
    const char* separator = r.note.empty() ? "" : "; ";
    if (r.raw == kNoRaw) {
      printf("| %s | %.1f %s | - | -%s%s |\n", r.figure.c_str(), r.daemon, r.unit.c_str(), separator, r.note.c_str());
      continue;
    }
    double ratio = r.higherIsBetter ? r.raw / r.daemon : r.daemon / r.raw;
    printf("| %s | %.1f %s | %.1f %s | %.2fx%s%s |\n", r.figure.c_str(), r.daemon, r.unit.c_str(), r.raw,
           r.unit.c_str(), ratio, separator, r.note.c_str());
  }
  for (const std::string& n : gNotes) printf("\n%s\n", n.c_str());
  fflush(stdout);
}

// Medians over repetitions of one figure of each side.
struct Pair {
  std::vector<double> daemon, raw;
  double d() const { return QRVBench::median(daemon); }
  double r() const { return QRVBench::median(raw); }
};

// ---- Look-ups ----

// Times `requests` look-ups over one connection; the latencies in
// microseconds.
std::vector<double> timeLookups(QRVContainerClient& client, const std::vector<QRVPlist>& requests, int count) {
  std::vector<double> micros;
  micros.reserve(count);
  for (int i = 0; i < count; i++) {
    auto begin = Clock::now();
    call(client, requests[i % requests.size()]);
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - begin).count());
  }
  return micros;
}

// Look-ups per second of `clients` threads, each with its own connection
// (made before the clock starts), `total` look-ups in all.
double lookupRate(const std::string& socketPath, const std::vector<QRVPlist>& requests, int clients, int total) {
  std::vector<QRVContainerClient> connections;
  for (int i = 0; i < clients; i++) connections.push_back(connectTo(socketPath));
  const int each = std::max(1, total / clients);
  std::atomic<int> ready{0};
  std::atomic<bool> go{false};
  std::atomic<bool> failed{false};
  std::vector<std::thread> threads;
  for (int t = 0; t < clients; t++) {
    threads.emplace_back([&, t] {
      ready++;
      while (!go) std::this_thread::yield();
      QRVClientError error;
      for (int i = 0; i < each && !failed; i++) {
        auto r = connections[t].call(requests[(t + i) % requests.size()], &error);
        if (!r || !r->ok()) failed = true;
      }
    });
  }
  while (ready < clients) std::this_thread::yield();
  auto begin = Clock::now();
  go = true;
  for (auto& t : threads) t.join();
  double seconds = millisSince(begin) / 1000;
  if (failed) fail("a concurrent look-up failed");
  return each * clients / seconds;
}

void benchLookups(const BenchRoot& root, const Sizes& sizes) {
  fprintf(stderr, "look-ups: %d containers\n", sizes.lookupContainers);
  DaemonRun daemon(root);
  QRVContainerClient client = daemon.firstAnswer();
  std::vector<QRVPlist> requests;
  std::unordered_map<std::string, QRVPlist> replies;
  for (int i = 0; i < sizes.lookupContainers; i++) {
    std::string id = identifierFor("lookup", i);
    requests.push_back(lookupRequest(id));
    call(client, requests.back());  // made here; the raw server answers with the look-up's reply
    replies[id] = call(client, requests.back()).reply;
  }
  RawLookupServer raw(root.path() + "/run/bench-raw.sock", replies);
  RawLookupServer checked(root.path() + "/run/bench-raw-checked.sock", replies,
                          RawLookupServer::Checks{root.path() + "/run/bench-raw.key"});
  QRVContainerClient rawClient = connectTo(raw.path());
  QRVContainerClient checkedClient = connectTo(checked.path());
  // Untimed warm-up of all three.
  timeLookups(client, requests, 200);
  timeLookups(rawClient, requests, 200);
  timeLookups(checkedClient, requests, 200);

  // The checked server's figures sit in the `raw` side of a second pair.
  Pair p50, p99, checkedP50, checkedP99;
  for (int rep = 0; rep < sizes.repetitions; rep++) {
    auto d = timeLookups(client, requests, sizes.latencyRequests);
    auto r = timeLookups(rawClient, requests, sizes.latencyRequests);
    auto c = timeLookups(checkedClient, requests, sizes.latencyRequests);
    for (Pair* p : {&p50, &checkedP50}) p->daemon.push_back(QRVBench::percentile(d, 0.50));
    for (Pair* p : {&p99, &checkedP99}) p->daemon.push_back(QRVBench::percentile(d, 0.99));
    p50.raw.push_back(QRVBench::percentile(r, 0.50));
    p99.raw.push_back(QRVBench::percentile(r, 0.99));
    checkedP50.raw.push_back(QRVBench::percentile(c, 0.50));
    checkedP99.raw.push_back(QRVBench::percentile(c, 0.99));
  }
  addRow("cache-hit look-up latency p50, one client", "us", p50.d(), p50.r(), false);
  addRow("cache-hit look-up latency p99, one client", "us", p99.d(), p99.r(), false);
  addRow("same p50, raw with the per-request checks", "us", checkedP50.d(), checkedP50.r(), false);
  addRow("same p99, raw with the per-request checks", "us", checkedP99.d(), checkedP99.r(), false);

  for (int clients : {1, 2, 8, 64}) {
    Pair rate, checkedRate;
    for (int rep = 0; rep < sizes.repetitions; rep++) {
      double d = lookupRate(root.socketPath(), requests, clients, sizes.throughputRequests);
      rate.daemon.push_back(d);
      checkedRate.daemon.push_back(d);
      rate.raw.push_back(lookupRate(raw.path(), requests, clients, sizes.throughputRequests));
      checkedRate.raw.push_back(lookupRate(checked.path(), requests, clients, sizes.throughputRequests));
    }
    const std::string figure = fmt::format("look-ups/s, {} concurrent client{}", clients, clients == 1 ? "" : "s");
    addRow(figure, "/s", rate.d(), rate.r(), true);
    addRow(figure + ", raw with the per-request checks", "/s", checkedRate.d(), checkedRate.r(), true);
  }
  gNotes.push_back(fmt::format(
      "Raw look-up server: {} worker threads on one epoll set, one-shot connections (the daemon's message "
      "service's parallelism); the reply it encodes is the daemon's own reply to the same request ({} bytes). "
      "With the per-request checks it also re-reads the peer's executable and confinement on descriptors "
      "kept since accept, stats the container's metadata file and seals a fresh sandbox token, with the "
      "daemon's own platform code.",
      kDaemonWorkerThreads, replies.begin()->second.toBinary().size()));
  fflush(stderr);
}

// ---- Durable creations ----

void fsyncPath(const std::string& path) {
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0 || fsync(fd) != 0) fail("fsync " + path + ": " + strerror(errno));
  close(fd);
}

void makeDirectory(const std::string& path, uid_t owner) {
  if (mkdir(path.c_str(), 0755) != 0 || chown(path.c_str(), owner, owner) != 0)
    fail("mkdir " + path + ": " + strerror(errno));
}

// What the daemon writes to disk for one new data container, as bare system
// calls (the daemon's own, traced with strace): the container's directory
// made in the staging directory; its metadata written to a temporary file
// beside it, flushed, renamed into the container and the container flushed;
// the default subdirectories; every directory that received a subdirectory
// flushed, the container last; the container renamed into the live class
// directory, and that directory flushed. Five fsyncs.
void rawCreation(const std::string& staging, const std::string& live, const QRVPlist& metadata) {
  const std::string uuid = QRVUUID::random().string();
  const std::string dir = staging + "/" + uuid;
  makeDirectory(dir, 501);
  const std::string temporary = staging + "/temp_metadata-" + uuid + ".plist";
  QRVPlist::Bytes bytes = metadata.toBinary();
  int fd = open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
  if (fd < 0 || write(fd, bytes.data(), bytes.size()) != static_cast<ssize_t>(bytes.size()) || fsync(fd) != 0)
    fail("metadata " + temporary + ": " + strerror(errno));
  close(fd);
  if (rename(temporary.c_str(), (dir + "/" + kMetadataFileName).c_str()) != 0) fail("rename metadata");
  fsyncPath(dir);
  for (const char* sub : {"Documents", "Library", "Library/Caches", "Library/Preferences", "SystemData", "tmp"})
    makeDirectory(dir + "/" + sub, 501);
  fsyncPath(dir + "/Library");
  fsyncPath(dir);
  if (rename(dir.c_str(), (live + "/" + uuid).c_str()) != 0) fail("rename live");
  fsyncPath(live);
}

// The daemon's directory step: made private, reopened without following a
// link, then given its mode and owner through the descriptor, so that nobody
// enters it before it is the owner's.
void makeDirectoryPrivately(int parent, const char* name, uid_t owner) {
  if (mkdirat(parent, name, 0700) != 0) fail(std::string("mkdir ") + name + ": " + strerror(errno));
  int fd = openat(parent, name, O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_DIRECTORY);
  if (fd < 0 || fchmod(fd, 0755) != 0 || fchown(fd, owner, owner) != 0)
    fail(std::string("mode ") + name + ": " + strerror(errno));
  close(fd);
}

// A directory accessor's cost on an existing directory: it is made if
// missing, and checked to be a directory.
void ensureDirectory(const std::string& path) {
  struct stat st;
  if ((mkdir(path.c_str(), 0700) != 0 && errno != EEXIST) || lstat(path.c_str(), &st) != 0)
    fail("ensure " + path + ": " + strerror(errno));
}

// The same creation with the daemon's own system calls, as traced: each
// directory made privately; the staging and live directories (and their
// parent) re-ensured at each access; a stale temporary file removed first
// and the file's mode set through its descriptor; each default subdirectory
// made relative to a fresh, link-free open of its parent.
void rawCreationWithDaemonSteps(const std::string& staging, const std::string& live, const QRVPlist& metadata) {
  const std::string parent = staging.substr(0, staging.rfind('/'));
  const std::string uuid = QRVUUID::random().string();
  const std::string dir = staging + "/" + uuid;
  ensureDirectory(parent);
  ensureDirectory(staging);
  makeDirectoryPrivately(AT_FDCWD, dir.c_str(), 501);
  ensureDirectory(parent);
  ensureDirectory(staging);
  const std::string temporary = staging + "/temp_metadata-" + uuid + ".plist";
  unlink(temporary.c_str());
  QRVPlist::Bytes bytes = metadata.toBinary();
  int fd = open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644);
  if (fd < 0 || write(fd, bytes.data(), bytes.size()) != static_cast<ssize_t>(bytes.size()) || fchmod(fd, 0644) != 0 ||
      fsync(fd) != 0)
    fail("metadata " + temporary + ": " + strerror(errno));
  close(fd);
  if (rename(temporary.c_str(), (dir + "/" + kMetadataFileName).c_str()) != 0) fail("rename metadata");
  fsyncPath(dir);
  for (const char* sub : {"Documents", "Library", "Library/Caches", "Library/Preferences", "SystemData", "tmp"}) {
    int container = open(dir.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_DIRECTORY);
    if (container < 0) fail("open " + dir);
    std::string_view path(sub);
    if (size_t slash = path.find('/'); slash != std::string_view::npos) {
      const std::string first(path.substr(0, slash));
      mkdirat(container, first.c_str(), 0700);  // exists: made just before
      int inner = openat(container, first.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_DIRECTORY);
      close(container);
      if (inner < 0) fail("open " + first);
      makeDirectoryPrivately(inner, sub + slash + 1, 501);
      close(inner);
    } else {
      makeDirectoryPrivately(container, sub, 501);
      close(container);
    }
  }
  fsyncPath(dir + "/Library");
  fsyncPath(dir);
  ensureDirectory(parent);
  ensureDirectory(live);
  if (rename(dir.c_str(), (live + "/" + uuid).c_str()) != 0) fail("rename live");
  fsyncPath(live);
}

void benchCreations(const BenchRoot& root, const Sizes& sizes) {
  fprintf(stderr, "creations: %d per repetition\n", sizes.creations);
  DaemonRun daemon(root);
  QRVContainerClient client = daemon.firstAnswer();
  // The metadata the raw side writes: the one the daemon wrote for a
  // container of the same class.
  QRVContainerResult sample = call(client, lookupRequest("com.example.bench.sample"));
  std::vector<uint8_t> bytes;
  {
    std::string file = *sample.path + "/" + kMetadataFileName;
    FILE* f = fopen(file.c_str(), "rb");
    if (!f) fail("cannot read " + file);
    uint8_t buffer[4096];
    for (size_t n; (n = fread(buffer, 1, sizeof buffer, f)) > 0;) bytes.insert(bytes.end(), buffer, buffer + n);
    fclose(f);
  }
  auto metadata = QRVPlist::fromBytes(bytes.data(), bytes.size());
  if (!metadata) fail("the daemon's metadata file does not decode");
  const std::string rawStaging = root.path() + "/bench-raw/staging";
  const std::string rawLive = root.path() + "/bench-raw/live";
  const std::string stepsStaging = root.path() + "/bench-raw/steps/staging";
  const std::string stepsLive = root.path() + "/bench-raw/steps/live";
  for (const std::string& d : {rawStaging, rawLive, stepsStaging, stepsLive}) std::filesystem::create_directories(d);

  Pair rate, steps;  // the daemon's side of `steps` repeats `rate`'s
  int next = 0;
  for (int rep = 0; rep < sizes.repetitions; rep++) {
    auto begin = Clock::now();
    for (int i = 0; i < sizes.creations; i++) {
      if (call(client, lookupRequest(identifierFor("created", next++))).existed.value_or(true))
        fail("a creation found an existing container");
    }
    rate.daemon.push_back(sizes.creations / (millisSince(begin) / 1000));
    steps.daemon.push_back(rate.daemon.back());
    begin = Clock::now();
    for (int i = 0; i < sizes.creations; i++) rawCreation(rawStaging, rawLive, *metadata);
    rate.raw.push_back(sizes.creations / (millisSince(begin) / 1000));
    begin = Clock::now();
    for (int i = 0; i < sizes.creations; i++) rawCreationWithDaemonSteps(stepsStaging, stepsLive, *metadata);
    steps.raw.push_back(sizes.creations / (millisSince(begin) / 1000));
  }
  addRow("durable creations/s, one client", "/s", rate.d(), rate.r(), true);
  addRow("same, raw with the daemon's own system calls", "/s", steps.d(), steps.r(), true);
  std::error_code ec;
  std::filesystem::remove_all(root.path() + "/bench-raw", ec);
}

// ---- First answer after a start ----

// Reads and decodes the metadata file of every container in `directory`,
// on `threads` threads; how many decoded to a dictionary with an identifier.
size_t rawReadAll(const std::string& directory, size_t threads) {
  std::vector<std::string> names;
  DIR* d = opendir(directory.c_str());
  if (!d) fail("cannot list " + directory);
  while (dirent* e = readdir(d))
    if (e->d_name[0] != '.') names.emplace_back(e->d_name);
  closedir(d);
  std::atomic<size_t> next{0}, decoded{0};
  auto work = [&] {
    std::unordered_map<std::string, QRVPlist> map;
    std::vector<uint8_t> bytes;
    for (size_t i; (i = next++) < names.size();) {
      int fd = open((directory + "/" + names[i] + "/" + kMetadataFileName).c_str(), O_RDONLY | O_CLOEXEC);
      if (fd < 0) continue;
      struct stat st;
      fstat(fd, &st);
      bytes.resize(static_cast<size_t>(st.st_size));
      ssize_t n = read(fd, bytes.data(), bytes.size());
      close(fd);
      if (n != st.st_size) continue;
      auto plist = QRVPlist::fromBytes(bytes.data(), bytes.size());
      if (!plist || !plist->isDictionary() || !plist->get(kMetadataIdentifierKey)) continue;
      map.emplace(plist->stringForKey(kMetadataIdentifierKey), std::move(*plist));
      decoded++;
    }
  };
  std::vector<std::thread> pool;
  for (size_t t = 1; t < threads; t++) pool.emplace_back(work);
  work();
  for (auto& t : pool) t.join();
  return decoded;
}

bool dropCaches() {
  sync();
  int fd = open("/proc/sys/vm/drop_caches", O_WRONLY | O_CLOEXEC);
  bool ok = fd >= 0 && write(fd, "3\n", 2) == 2;
  if (fd >= 0) close(fd);
  return ok;
}

// One start: milliseconds from spawn to the first answer, and to the first
// look-up answered (asked right after that answer).
std::pair<double, double> timedStart(const BenchRoot& root, const std::string& identifier) {
  DaemonRun daemon(root);
  QRVContainerClient client = daemon.firstAnswer();
  double started = millisSince(daemon.spawned());
  QRVContainerResult found = call(client, lookupRequest(identifier));
  double looked = millisSince(daemon.spawned());
  if (!found.existed.value_or(false)) fail("the first look-up did not find the container");
  return {started, looked};
}

void benchFirstAnswer(const BenchRoot& root, const Sizes& sizes) {
  fprintf(stderr, "first answer: making %d containers through the daemon\n", sizes.startContainers);
  std::string classDirectory;
  {
    DaemonRun daemon(root);
    QRVContainerClient client = daemon.firstAnswer();
    for (int i = 0; i < sizes.startContainers; i++) {
      QRVContainerResult r = call(client, lookupRequest(identifierFor("start", i)));
      if (i == 0) classDirectory = std::filesystem::path(*r.path).parent_path();
      if (i % 1000 == 999) fprintf(stderr, "  %d\n", i + 1);
    }
  }
  const std::string probe = identifierFor("start", sizes.startContainers / 2);
  const size_t inDirectory = rawReadAll(classDirectory, 1);
  if (inDirectory < static_cast<size_t>(sizes.startContainers)) fail("the raw read missed containers");

  auto measure = [&](bool cold) {
    Pair first, rebuild;
    std::vector<double> startOnly;
    timedStart(root, probe);  // untimed: the first start after the creations
    for (int rep = 0; rep < sizes.repetitions; rep++) {
      if (cold && !dropCaches()) return false;
      auto [started, looked] = timedStart(root, probe);
      startOnly.push_back(started);
      first.daemon.push_back(looked);
      rebuild.daemon.push_back(looked - started);
      if (cold && !dropCaches()) return false;
      auto begin = Clock::now();
      if (rawReadAll(classDirectory, cold ? kColdReadThreads : 1) != inDirectory) fail("raw read fell short");
      double raw = millisSince(begin);
      first.raw.push_back(raw);
      rebuild.raw.push_back(raw);
    }
    const char* cache = cold ? "cold" : "warm";
    const std::string rawNote = fmt::format("raw: read+decode of every metadata file, {} thread{}",
                                            cold ? kColdReadThreads : 1, cold ? "s" : "");
    addRow(fmt::format("first look-up after start, {} containers, {} page cache (spawn to answer)", inDirectory, cache),
           "ms", first.d(), first.r(), false, rawNote);
    addRow(fmt::format("  of which start-up: spawn to a first answer needing no class map, {}", cache), "ms",
           QRVBench::median(startOnly), kNoRaw, false);
    addRow(fmt::format("  of which the look-up that builds the class map, {}", cache), "ms", rebuild.d(), rebuild.r(),
           false, rawNote);
    return true;
  };
  measure(/*cold=*/false);
  if (!measure(/*cold=*/true))
    gNotes.push_back("Cold page cache row skipped: writing /proc/sys/vm/drop_caches is not permitted here.");
}

// ---- Disk usage ----

// `count` files of varied sizes in 100 directories below `directory`.
void fillWithFiles(const std::string& directory, int count) {
  std::vector<char> bytes(9000, 'x');
  for (int i = 0; i < count; i++) {
    std::string sub = fmt::format("{}/d{:03}", directory, i % 100);
    if (i < 100) makeDirectory(sub, 501);
    int fd = open(fmt::format("{}/f{}", sub, i).c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
    size_t size = static_cast<size_t>(i * 37) % bytes.size();
    if (fd < 0 || write(fd, bytes.data(), size) != static_cast<ssize_t>(size)) fail("cannot fill " + sub);
    close(fd);
  }
}

uint64_t duBytes(const std::string& directory) {
  FILE* p = popen(("du -sB1 '" + directory + "'").c_str(), "r");
  if (!p) fail("cannot run du");
  unsigned long long bytes = 0;
  int fields = fscanf(p, "%llu", &bytes);
  if (pclose(p) != 0 || fields != 1) fail("du failed on " + directory);
  return bytes;
}

void benchDiskUsage(const BenchRoot& root, const Sizes& sizes) {
  fprintf(stderr, "disk usage: %d files\n", sizes.usageFiles);
  DaemonRun daemon(root);
  QRVContainerClient client = daemon.firstAnswer();
  QRVContainerResult container = call(client, lookupRequest("com.example.bench.usage"));
  fillWithFiles(*container.path + "/Documents", sizes.usageFiles);
  QRVContainerRef ref{.identifier = "com.example.bench.usage",
                      .containerClass = kDataClass,
                      .persona = std::nullopt,
                      .uuid = container.uuid};
  uint64_t daemonBytes = 0, rawBytes = 0;
  Pair time;
  duBytes(*container.path);  // untimed: the tree in the page cache
  for (int rep = 0; rep < sizes.repetitions; rep++) {
    auto begin = Clock::now();
    QRVContainerResult usage = call(client, QRVContainerRequests::diskUsage(ref));
    time.daemon.push_back(millisSince(begin));
    daemonBytes = usage.diskUsage.value_or(0);
    begin = Clock::now();
    rawBytes = duBytes(*container.path);
    time.raw.push_back(millisSince(begin));
  }
  addRow(fmt::format("disk usage of a container of {} files", sizes.usageFiles), "ms", time.d(), time.r(), false,
         fmt::format("du's time includes starting du; daemon {} bytes, du {} bytes: {}", daemonBytes, rawBytes,
                     daemonBytes == rawBytes ? "equal" : "DIFFERENT"));
}

// ---- The machine ----

std::string fileSystemOf(const std::string& directory) {
  FILE* p = popen(("findmnt -n -o FSTYPE -T '" + directory + "'").c_str(), "r");
  char name[64] = "unknown";
  if (p) {
    if (fscanf(p, "%63s", name) != 1) snprintf(name, sizeof name, "unknown");
    pclose(p);
  }
  return name;
}

void printMachine(const std::string& directory, const Sizes& sizes, bool quick) {
  utsname u{};
  uname(&u);
  struct sysinfo si {};
  sysinfo(&si);
  printf("machine: nproc %ld, memory %.1f GiB, Linux %s, %s on %s (%s)\n", sysconf(_SC_NPROCESSORS_ONLN),
         static_cast<double>(si.totalram) * si.mem_unit / (1u << 30), u.release, fileSystemOf(directory).c_str(),
         directory.c_str(), QRV_BENCH_BUILD_TYPE);
  printf("medians of %d interleaved repetitions (daemon, raw, daemon, raw, ...)%s\n", sizes.repetitions,
         quick ? "; --quick sizes, not figures to keep" : "");
  fflush(stdout);
}

int run(int argc, char** argv) {
  const char* tmp = getenv("TMPDIR");
  std::string directory = tmp && *tmp ? tmp : "/tmp";
  bool quick = false;
  int repetitions = 0;
  std::string only;  // empty: every row
  for (int i = 1; i < argc; i++) {
    std::string arg = argv[i];
    if (arg == "--dir" && i + 1 < argc) {
      directory = argv[++i];
    } else if (arg == "--quick") {
      quick = true;
    } else if (arg == "--repetitions" && i + 1 < argc) {
      repetitions = atoi(argv[++i]);
    } else if (arg == "--only" && i + 1 < argc) {
      only = argv[++i];
    } else {
      fprintf(stderr, "usage: %s [--dir DIR] [--quick] [--repetitions N] [--only lookups|creations|usage|first]\n",
              argv[0]);
      return 2;
    }
  }
  Sizes sizes = quick ? quickSizes() : Sizes{};
  if (repetitions > 0) sizes.repetitions = quick ? repetitions : std::max(5, repetitions);
  if (getuid() != 0) {
    fprintf(stderr, "needs root: the daemon and the raw side change owners\n");
    return 2;
  }
  directory = std::filesystem::absolute(directory).string();
  // QRVDaemonProcess makes its root in the temporary directory.
  setenv("TMPDIR", directory.c_str(), 1);
  startSignalWatcher();
  printMachine(directory, sizes, quick);

  auto wanted = [&](const char* rows) { return only.empty() || only == rows; };
  if (wanted("lookups") || wanted("creations") || wanted("usage")) {
    BenchRoot root;
    if (wanted("lookups")) benchLookups(root, sizes);
    if (wanted("creations")) benchCreations(root, sizes);
    if (wanted("usage")) benchDiskUsage(root, sizes);
  }
  if (wanted("first")) {
    // A root of its own, so that the class holds exactly the containers
    // made for these rows.
    BenchRoot root;
    benchFirstAnswer(root, sizes);
    // Before the root goes: removing its containers takes a while.
    printTable();
    fprintf(stderr, "removing the temporary root\n");
  } else {
    printTable();
  }
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  try {
    return run(argc, argv);
  } catch (const std::exception& e) {
    fprintf(stderr, "QRVPerformance_bench: %s\n", e.what());
    return 1;
  }
}

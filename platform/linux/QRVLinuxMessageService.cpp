#include "platform/linux/QRVLinuxMessageService.h"

#include <fcntl.h>
#include <malloc.h>
#include <poll.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>

#include "base/QRVLog.h"
#include "base/QRVWireFrame.h"
#include "platform/linux/QRVUnixSocket.h"
#include "platform/linux/QRVPeerProcess.h"
#include "platform/linux/QRVProcInfo.h"

namespace {

constexpr uint64_t kListenerTag = 0;
constexpr uint64_t kWakeTag = UINT64_MAX;
constexpr size_t kReadChunk = 64 * 1024;
// A connection keeps buffers up to this size between frames; a larger one
// (left by a multi-megabyte request or reply) is given back after its frame.
constexpr size_t kKeptBufferCapacity = 256 * 1024;

int64_t nowMillis() {
  return std::chrono::duration_cast<std::chrono::milliseconds>(
             std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

}  // namespace

class QRVLinuxMessageService::Connection : public QRVConnection {
 public:
  Connection(QRVLinuxMessageService* service, uint64_t id, int fd, const ucred& cred, QRVAuditToken token,
             int pidfd, std::optional<uint32_t> persona, std::unique_ptr<QRVPeerProcess> peer)
      : service_(service),
        id_(id),
        fd_(fd),
        pidfd_(pidfd),
        cred_(cred),
        token_(token),
        persona_(persona),
        peer_(std::move(peer)) {}

  ~Connection() override {
    if (fd_ >= 0) ::close(fd_);
    if (pidfd_ >= 0) ::close(pidfd_);
    // A peer that left in the middle of a large frame: give its buffer back
    // to the system too (see process()).
    if (in_.capacity() > kKeptBufferCapacity) {
      std::vector<uint8_t>().swap(in_);
      malloc_trim(0);
    }
  }

  pid_t pid() const override { return cred_.pid; }
  uid_t euid() const override { return cred_.uid; }
  gid_t egid() const override { return cred_.gid; }
  const QRVAuditToken& auditToken() const override { return token_; }
  std::optional<uint32_t> personaID() const override { return persona_; }
  std::optional<QRVPeerProcessState> peerProcessState() override { return peer_->state(); }

  void setEventHandler(EventHandler handler) override {
    QRVMutexLock lock(&mutex_);
    handler_ = std::move(handler);
  }

  void resume() override {
    QRVMutexLock lock(&mutex_);
    if (resumed_ || closed_) return;
    resumed_ = true;
    epoll_event ev{};
    ev.events = EPOLLIN | EPOLLONESHOT;
    ev.data.u64 = id_;
    if (epoll_ctl(service_->epollFd_, EPOLL_CTL_ADD, fd_, &ev) != 0)
      closeLocked(fmt::format("cannot watch the connection: {}", strerror(errno)));
  }

  void cancel() override {
    QRVMutexLock lock(&mutex_);
    closeLocked("");
  }

  void sendReply(uint64_t messageId, const QRVPlist& reply) override {
    std::vector<uint8_t> frame = QRVWireFrame::encode(reply, 0, messageId);
    QRVMutexLock lock(&mutex_);
    if (closed_) return;
    if (pendingOutput() == 0) lastProgress_ = nowMillis();
    out_.insert(out_.end(), frame.begin(), frame.end());
    // The worker that owns the connection flushes when its handler returns;
    // a reply sent later, from elsewhere, is flushed here.
    if (!busy_ && resumed_) {
      flushLocked();
      if (!closed_) rearmLocked();
    }
  }

  // Runs on a worker for an epoll event of this connection.
  void process(uint32_t events) {
    QRVMutexLock lock(&mutex_);
    if (closed_ || busy_) return;  // another worker already owns it
    busy_ = true;
    if (events & EPOLLERR) {
      // A peer that left with unread replies shows as a reset: an ordinary end.
      int err = 0;
      socklen_t len = sizeof err;
      getsockopt(fd_, SOL_SOCKET, SO_ERROR, &err, &len);
      closeLocked(err == ECONNRESET || err == EPIPE || err == 0 ? "" : fmt::format("socket error: {}", strerror(err)));
      releaseWorkerLocked();
      return;
    }
    EventHandler handler = handler_;
    // Stays open while this worker owns the connection (see closeLocked).
    const int fd = fd_;
    // A connection keeps its worker while it has requests and its replies are
    // being read; the other workers serve everyone else meanwhile.
    for (;;) {
      if (!flushLocked()) break;
      if (pendingOutput() > 0) break;  // backpressure: read nothing until the peer reads
      lock.unlock();
      std::string problem;
      std::optional<QRVMessage> message = nextMessage(&problem);
      lock.lock();
      if (closed_) break;
      if (!problem.empty()) {
        closeLocked(problem);
        break;
      }
      if (message) {
        lock.unlock();
        deliver(handler, std::move(*message));
        // The request's buffer and everything its handler built from it are
        // free now, but the allocator keeps freed memory in its arenas (one
        // per worker) unless told: without this a burst of large requests
        // leaves the daemon at hundreds of megabytes for good.
        if (largeFrameSeen_) {
          largeFrameSeen_ = false;
          malloc_trim(0);
        }
        // Bytes of the next frame that came with this one waited for the
        // handler; their time starts now.
        if (in_.size() > inOffset_) frameStarted_ = nowMillis();
        lock.lock();
        if (closed_) break;
        continue;
      }
      if (peerEOF_) {
        closeLocked(in_.empty() ? "" : "peer closed the connection in the middle of a frame");
        break;
      }
      lock.unlock();
      bool wouldBlock = readSome(fd, &problem);
      lock.lock();
      if (!problem.empty()) {
        closeLocked(problem);
        break;
      }
      if (wouldBlock) break;
    }
    partialFrameSince_ = in_.size() > inOffset_ ? frameStarted_ : 0;
    releaseWorkerLocked();
    if (!closed_) rearmLocked();
  }

  // Closes the connection when its replies have not moved for longer than
  // the write timeout, or when it left a frame unfinished for longer than
  // the read timeout. While a worker owns the connection, or replies wait,
  // the daemon is not reading, so an unfinished frame is not the peer's
  // fault then.
  void closeIfStalled(int64_t now, int64_t writeTimeoutMillis, int64_t readTimeoutMillis) {
    QRVMutexLock lock(&mutex_);
    if (closed_) return;
    if (pendingOutput() > 0) {
      if (now - lastProgress_ > writeTimeoutMillis) closeLocked("client is not reading its replies");
      return;
    }
    if (!busy_ && partialFrameSince_ != 0 && now - partialFrameSince_ > readTimeoutMillis)
      closeLocked(fmt::format("client left a frame unfinished for more than {} ms", readTimeoutMillis));
  }

 private:
  size_t pendingOutput() const REQUIRES(mutex_) { return out_.size() - outOffset_; }

  // Takes the next complete frame out of the input buffer. Only the owning
  // worker touches in_, so no lock is needed.
  std::optional<QRVMessage> nextMessage(std::string* problem) {
    if (in_.size() - inOffset_ < QRVWireFrame::kHeaderSize) return std::nullopt;
    QRVWireFrame::Header h = QRVWireFrame::decodeHeader(in_.data() + inOffset_);
    if (h.length > QRVWireFrame::kMaxBodySize) {
      *problem = fmt::format("frame of {} bytes exceeds the limit of {}", h.length,
                             QRVWireFrame::kMaxBodySize);
      return std::nullopt;
    }
    if (in_.size() - inOffset_ < QRVWireFrame::kHeaderSize + h.length) return std::nullopt;
    auto body = QRVWireFrame::decodeBody(in_.data() + inOffset_ + QRVWireFrame::kHeaderSize, h.length);
    inOffset_ += QRVWireFrame::kHeaderSize + h.length;
    if (h.length >= kKeptBufferCapacity) largeFrameSeen_ = true;
    if (inOffset_ == in_.size()) {
      in_.clear();
      inOffset_ = 0;
      if (in_.capacity() > kKeptBufferCapacity) std::vector<uint8_t>().swap(in_);
    }
    if (!body) {
      *problem = "message body is not a dictionary";
      return std::nullopt;
    }
    QRVMessage m;
    m.body = std::move(*body);
    m.messageId = h.messageId;
    m.hasReplyContext = (h.flags & QRVWireFrame::kFlagWantsReply) != 0;
    m.connection = weak_from_this();
    return m;
  }

  // Reads what the socket has, up to one chunk. Returns true when it had
  // nothing (would block).
  bool readSome(int fd, std::string* problem) {
    if (inOffset_ > 0) {
      in_.erase(in_.begin(), in_.begin() + static_cast<ptrdiff_t>(inOffset_));
      inOffset_ = 0;
    }
    // The first bytes after a complete frame start the next one.
    if (in_.empty()) frameStarted_ = nowMillis();
    // Received on the stack and appended: growing the buffer by a chunk
    // first would zero 64 KiB for every read, most of which find a small
    // frame or nothing at all.
    uint8_t chunk[kReadChunk];
    ssize_t n;
    do {
      n = recv(fd, chunk, sizeof chunk, 0);
    } while (n < 0 && errno == EINTR);
    if (n > 0) in_.insert(in_.end(), chunk, chunk + n);
    if (n == 0) {
      peerEOF_ = true;
      return false;
    }
    if (n < 0) {
      if (errno == EAGAIN || errno == EWOULDBLOCK) return true;
      if (errno == ECONNRESET) {
        peerEOF_ = true;
        in_.clear();
        return false;
      }
      *problem = fmt::format("read failed: {}", strerror(errno));
    }
    return false;
  }

  void deliver(const EventHandler& handler, QRVMessage message) {
    if (!handler) return;
    QRVConnectionEvent event;
    event.kind = QRVConnectionEvent::Kind::kMessage;
    event.message = std::move(message);
    handler(shared_from_this(), event);
  }

  // Writes what it can. Returns false when the connection had to be closed.
  bool flushLocked() REQUIRES(mutex_) {
    while (pendingOutput() > 0) {
      ssize_t n = ::send(fd_, out_.data() + outOffset_, pendingOutput(), MSG_NOSIGNAL | MSG_DONTWAIT);
      if (n < 0) {
        if (errno == EINTR) continue;
        if (errno == EAGAIN || errno == EWOULDBLOCK) return true;
        closeLocked(errno == EPIPE || errno == ECONNRESET ? ""
                                                          : fmt::format("write failed: {}", strerror(errno)));
        return false;
      }
      outOffset_ += static_cast<size_t>(n);
      lastProgress_ = nowMillis();
    }
    out_.clear();
    outOffset_ = 0;
    if (out_.capacity() > kKeptBufferCapacity) std::vector<uint8_t>().swap(out_);
    return true;
  }

  void rearmLocked() REQUIRES(mutex_) {
    epoll_event ev{};
    // While replies wait to be written, requests are left unread.
    ev.events = (pendingOutput() > 0 ? EPOLLOUT : EPOLLIN) | EPOLLONESHOT;
    ev.data.u64 = id_;
    if (epoll_ctl(service_->epollFd_, EPOLL_CTL_MOD, fd_, &ev) != 0)
      closeLocked(fmt::format("cannot re-arm the connection: {}", strerror(errno)));
  }

  // The worker gives up the connection, finishing a close that came while
  // it was reading.
  void releaseWorkerLocked() REQUIRES(mutex_) {
    busy_ = false;
    if (closed_ && fd_ >= 0) {
      ::close(fd_);
      fd_ = -1;
    }
  }

  // An empty reason is an ordinary end (the peer left, or the daemon
  // cancelled); anything else is logged as the reason for cutting it off.
  void closeLocked(const std::string& reason) REQUIRES(mutex_) {
    if (closed_) return;
    closed_ = true;
    if (!reason.empty())
      QRVLogError("closing connection from pid {} (uid {}): {}", cred_.pid, cred_.uid, reason);
    epoll_ctl(service_->epollFd_, EPOLL_CTL_DEL, fd_, nullptr);
    // A worker that owns the connection may be reading the descriptor
    // outside the lock. Closing it now could give its number to the next
    // open, and the worker would read another client's bytes. It is shut
    // down instead, which ends that read at once, and the worker closes it.
    if (busy_) {
      ::shutdown(fd_, SHUT_RDWR);
    } else {
      ::close(fd_);
      fd_ = -1;
    }
    out_.clear();
    outOffset_ = 0;
    service_->forget(id_);
  }

  QRVLinuxMessageService* const service_;
  const uint64_t id_;
  int fd_ GUARDED_BY(mutex_);
  int pidfd_;
  const ucred cred_;
  const QRVAuditToken token_;
  const std::optional<uint32_t> persona_;
  // Used only by the thread that delivers the connection's events.
  const std::unique_ptr<QRVPeerProcess> peer_;

  QRVMutex mutex_;
  EventHandler handler_ GUARDED_BY(mutex_);
  bool resumed_ GUARDED_BY(mutex_) = false;
  bool busy_ GUARDED_BY(mutex_) = false;  // a worker owns the connection
  bool closed_ GUARDED_BY(mutex_) = false;
  std::vector<uint8_t> out_ GUARDED_BY(mutex_);
  size_t outOffset_ GUARDED_BY(mutex_) = 0;
  int64_t lastProgress_ GUARDED_BY(mutex_) = 0;
  // When the frame left unfinished in in_ began (0: none), published by the
  // owning worker for the sweep.
  int64_t partialFrameSince_ GUARDED_BY(mutex_) = 0;

  // Owned by the worker that holds busy_.
  std::vector<uint8_t> in_;
  size_t inOffset_ = 0;
  bool peerEOF_ = false;
  int64_t frameStarted_ = 0;
  bool largeFrameSeen_ = false;
};

QRVLinuxMessageService::QRVLinuxMessageService(Options options) : options_(std::move(options)) {}

QRVLinuxMessageService::~QRVLinuxMessageService() {
  stopping_ = true;
  if (wakeFd_ >= 0) {
    uint64_t one = 1;
    ssize_t ignored = write(wakeFd_, &one, sizeof one);
    (void)ignored;
  }
  for (auto& t : workers_) t.join();
  std::map<uint64_t, std::shared_ptr<Connection>> connections;
  {
    QRVMutexLock lock(&mutex_);
    connections.swap(connections_);
  }
  for (auto& [id, c] : connections) c->cancel();
  if (listenFd_ >= 0) ::close(listenFd_);
  if (wakeFd_ >= 0) ::close(wakeFd_);
  if (epollFd_ >= 0) ::close(epollFd_);
}

bool QRVLinuxMessageService::openListeningSocket(const std::string& name, QRVError* error) {
  // Socket activation: systemd hands over a socket named after the service.
  char** names = nullptr;
  int n = sd_listen_fds_with_names(1, &names);
  for (int i = 0; i < n; i++) {
    if (listenFd_ < 0 && names && names[i] && name == names[i]) listenFd_ = SD_LISTEN_FDS_START + i;
  }
  if (names) {
    for (int i = 0; i < n; i++) free(names[i]);
    free(names);
  }
  if (listenFd_ >= 0) {
    int flags = fcntl(listenFd_, F_GETFL);
    fcntl(listenFd_, F_SETFL, flags | O_NONBLOCK);
    QRVLogNotice("using socket-activated listener for {}", name);
    return true;
  }

  const std::string& path = options_.socketPath;
  sockaddr_un addr;
  if (!QRVUnixSocket::prepareToBind(path, &addr, error)) return false;

  listenFd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  if (listenFd_ < 0) return QRVFail(error, QRV_POSIX_ERROR(errno, "socket: {}", strerror(errno)));
  if (bind(listenFd_, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0 ||
      chmod(path.c_str(), 0666) != 0 || ::listen(listenFd_, SOMAXCONN) != 0) {
    int e = errno;
    ::close(listenFd_);
    listenFd_ = -1;
    return QRVFail(error, QRV_POSIX_ERROR(e, "cannot listen on {}: {}", path, strerror(e)));
  }
  return true;
}

bool QRVLinuxMessageService::listen(const std::string& name, std::shared_ptr<QRVSerialQueue> queue,
                                    ConnectionHandler onConnection, QRVError* error) {
  listenerQueue_ = std::move(queue);
  onConnection_ = std::move(onConnection);
  epollFd_ = epoll_create1(EPOLL_CLOEXEC);
  wakeFd_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (epollFd_ < 0 || wakeFd_ < 0)
    return QRVFail(error, QRV_POSIX_ERROR(errno, "epoll set-up failed: {}", strerror(errno)));
  if (!openListeningSocket(name, error)) return false;

  epoll_event ev{};
  ev.events = EPOLLIN | EPOLLONESHOT;
  ev.data.u64 = kListenerTag;
  epoll_ctl(epollFd_, EPOLL_CTL_ADD, listenFd_, &ev);
  ev.events = EPOLLIN;  // level-triggered: wakes every worker on shutdown
  ev.data.u64 = kWakeTag;
  epoll_ctl(epollFd_, EPOLL_CTL_ADD, wakeFd_, &ev);

  for (size_t i = 0; i < std::max<size_t>(1, options_.workerThreads); i++)
    workers_.emplace_back([this] { workerLoop(); });
  return true;
}

void QRVLinuxMessageService::workerLoop() {
  // Often enough that no stall outlives its timeout by much more than a
  // quarter of it; never more than once a second is needed for the defaults.
  const int64_t sweepInterval = std::clamp<int64_t>(
      std::min(options_.writeStallTimeout.count(), options_.readStallTimeout.count()) / 4, 50, 1000);
  epoll_event events[16];
  while (!stopping_) {
    int n = epoll_wait(epollFd_, events, 16, static_cast<int>(sweepInterval));
    if (stopping_) return;
    for (int i = 0; i < n; i++) {
      uint64_t tag = events[i].data.u64;
      if (tag == kWakeTag) continue;
      if (tag == kListenerTag) {
        // New connections are announced on the listener queue, after
        // whatever it was doing (start-up) has finished.
        listenerQueue_->async([this] { acceptPending(); });
      } else {
        handleConnectionEvent(tag, events[i].events);
      }
    }
    int64_t now = nowMillis();
    int64_t last = lastSweep_.load();
    if (now - last >= sweepInterval && lastSweep_.compare_exchange_strong(last, now)) sweepStalledConnections();
  }
}

void QRVLinuxMessageService::acceptPending() {
  for (int accepted = 0; accepted < 64; accepted++) {
    int fd = QRVUnixSocket::next(listenFd_, "com.kelva.quorvad");
    if (fd < 0) break;
    ucred cred{};
    socklen_t len = sizeof cred;
    if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0) {
      QRVLogError("cannot read peer credentials: {}", strerror(errno));
      ::close(fd);
      continue;
    }
    // At the bound the connection is taken off the backlog and closed: the
    // peer learns at once, instead of waiting in the backlog while its
    // slot is held by others.
    if (openConnections() >= options_.maxConnections) {
      ::close(fd);
      refuseAtBound(cred);
      continue;
    }
    // The pidfd pins the peer's identity: if the process is gone by the time
    // its start time has been read, the pid may already be someone else's.
    int pidfd = static_cast<int>(syscall(SYS_pidfd_open, cred.pid, 0));
    QRVAuditToken token = QRVProcInfo::auditTokenForPeer(cred, pidfd);
    std::optional<uint32_t> persona = QRVProcInfo::personaFromCgroup(cred.pid);
    auto peer = std::make_unique<QRVPeerProcess>(cred.pid, pidfd);
    std::shared_ptr<Connection> connection;
    {
      QRVMutexLock lock(&mutex_);
      uint64_t id = nextConnectionId_++;
      connection = std::make_shared<Connection>(this, id, fd, cred, token, pidfd, persona, std::move(peer));
      connections_[id] = connection;
    }
    if (onConnection_) onConnection_(connection);
  }
  epoll_event ev{};
  ev.events = EPOLLIN | EPOLLONESHOT;
  ev.data.u64 = kListenerTag;
  epoll_ctl(epollFd_, EPOLL_CTL_MOD, listenFd_, &ev);
}

void QRVLinuxMessageService::refuseAtBound(const ucred& cred) {
  refusedSinceLog_++;
  int64_t now = nowMillis();
  if (lastRefusalLog_ != 0 && now - lastRefusalLog_ < 1000) return;
  QRVLogError(
      "refusing connection from pid {} (uid {}): the limit of {} open connections is reached ({} refused "
      "since the last report)",
      cred.pid, cred.uid, options_.maxConnections, refusedSinceLog_);
  lastRefusalLog_ = now;
  refusedSinceLog_ = 0;
}

void QRVLinuxMessageService::handleConnectionEvent(uint64_t id, uint32_t events) {
  if (std::shared_ptr<Connection> c = find(id)) c->process(events);
}

void QRVLinuxMessageService::sweepStalledConnections() {
  std::vector<std::shared_ptr<Connection>> all;
  {
    QRVMutexLock lock(&mutex_);
    for (auto& [id, c] : connections_) all.push_back(c);
  }
  int64_t now = nowMillis();
  for (auto& c : all) c->closeIfStalled(now, options_.writeStallTimeout.count(), options_.readStallTimeout.count());
}

void QRVLinuxMessageService::forget(uint64_t id) {
  QRVMutexLock lock(&mutex_);
  connections_.erase(id);
}

std::shared_ptr<QRVLinuxMessageService::Connection> QRVLinuxMessageService::find(uint64_t id) const {
  QRVMutexLock lock(&mutex_);
  auto it = connections_.find(id);
  return it == connections_.end() ? nullptr : it->second;
}

void QRVLinuxMessageService::beginTransaction() { transactions_++; }
void QRVLinuxMessageService::endTransaction() { transactions_--; }

bool QRVLinuxMessageService::isIdle() const { return transactions_ == 0 && openConnections() == 0; }

size_t QRVLinuxMessageService::openConnections() const {
  QRVMutexLock lock(&mutex_);
  return connections_.size();
}

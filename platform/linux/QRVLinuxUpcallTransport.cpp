#include "platform/linux/QRVLinuxUpcallTransport.h"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <map>
#include <vector>

#include "base/QRVDescriptorPassing.h"
#include "base/QRVLog.h"
#include "base/QRVMutex.h"
#include "platform/linux/QRVUnixSocket.h"
#include "platform/linux/QRVProcInfo.h"

namespace {

constexpr uint64_t kListenerTag = 0;
constexpr uint64_t kWakeTag = UINT64_MAX;
constexpr int kSeals = QRVDescriptorPassing::kContentSeals;

class Descriptor {
 public:
  Descriptor(int fd = -1) : fd_(fd) {}  // NOLINT: converts the received ints
  Descriptor(Descriptor&& o) noexcept : fd_(o.fd_) { o.fd_ = -1; }
  Descriptor& operator=(Descriptor&& o) noexcept {
    std::swap(fd_, o.fd_);
    return *this;
  }
  ~Descriptor() {
    if (fd_ >= 0) ::close(fd_);
  }
  int get() const { return fd_; }

 private:
  int fd_;
};

class MappedRegion : public QRVUpcallMemory {
 public:
  MappedRegion(void* address, size_t size) : address_(address), size_(size) {}
  ~MappedRegion() override { munmap(address_, size_); }
  const uint8_t* bytes() const override { return static_cast<const uint8_t*>(address_); }
  size_t size() const override { return size_; }

 private:
  void* const address_;
  const size_t size_;
};

int64_t nowSeconds() {
  return std::chrono::duration_cast<std::chrono::seconds>(std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

}  // namespace

struct QRVLinuxUpcallTransport::Shared {
  int epollFd = -1;
  int listenFd = -1;
  int wakeFd = -1;
  std::shared_ptr<QRVSerialQueue> queue;
  Handler handler;
  std::atomic<bool> stopping{false};

  mutable QRVMutex mutex;
  std::map<uint64_t, std::shared_ptr<Connection>> connections GUARDED_BY(mutex);
  uint64_t nextID GUARDED_BY(mutex) = 1;

  ~Shared() {
    {
      QRVMutexLock lock(&mutex);
      connections.clear();
    }
    if (listenFd >= 0) ::close(listenFd);
    if (wakeFd >= 0) ::close(wakeFd);
    if (epollFd >= 0) ::close(epollFd);
  }

  void forget(uint64_t id) {
    QRVMutexLock lock(&mutex);
    connections.erase(id);
  }
};

class QRVLinuxUpcallTransport::Connection {
 public:
  Connection(uint64_t id, int fd, const ucred& cred, QRVAuditToken token)
      : id_(id), fd_(fd), cred_(cred), token_(token) {}
  uint64_t id() const { return id_; }
  int fd() const { return fd_.get(); }
  const ucred& credentials() const { return cred_; }
  const QRVAuditToken& token() const { return token_; }

  // Waits for the next message (or the peer's leaving) of this connection.
  bool arm(int epollFd, int op) {
    epoll_event ev{};
    ev.events = EPOLLIN | EPOLLRDHUP | EPOLLONESHOT;
    ev.data.u64 = id_;
    return epoll_ctl(epollFd, op, fd_.get(), &ev) == 0;
  }

  // Sends `reply`; false when the peer is gone or will not take it.
  bool send(const QRVUpcallReply& reply) {
    Descriptor region;
    if (reply.region) {
      region = Descriptor(QRVDescriptorPassing::makeSealedMemory("quorvad-upcall-reply", *reply.region));
      if (region.get() < 0) {
        // Nothing the peer could use: it learns from the connection's end.
        QRVLogError("cannot make the reply region for pid {}: {}", cred_.pid, strerror(errno));
        return false;
      }
    }
    if (QRVDescriptorPassing::send(fd_.get(), reply.message, region.get(), MSG_DONTWAIT) >= 0) return true;
    if (errno == EPIPE || errno == ECONNRESET)
      QRVLogDebug("pid {} left before its upcall reply", cred_.pid);
    else
      QRVLogError("cannot send the upcall reply to pid {}: {}", cred_.pid, strerror(errno));
    return false;
  }

 private:
  const uint64_t id_;
  const Descriptor fd_;
  const ucred cred_;
  const QRVAuditToken token_;
};

class QRVLinuxUpcallTransport::Request : public QRVUpcallRequest {
 public:
  Request(std::vector<uint8_t> message, size_t length, std::optional<QRVAuditToken> sender,
          std::vector<Descriptor> regions,
          bool regionsDropped)
      : message_(std::move(message)),
        length_(length),
        sender_(sender),
        regions_(std::move(regions)),
        regionsDropped_(regionsDropped) {}

  const std::vector<uint8_t>& message() const override { return message_; }
  size_t messageLength() const override { return length_; }
  std::optional<QRVAuditToken> sender() const override { return sender_; }
  // Descriptors the kernel dropped for want of room count too: a message
  // that came with them did not come with one region.
  size_t regionCount() const override { return regions_.size() + (regionsDropped_ ? 1 : 0); }

  std::unique_ptr<QRVUpcallMemory> mapRegion(size_t size, QRVError* error) override {
    if (regionCount() != 1) {
      QRVFail(error, QRV_POSIX_ERROR_QUIET(EINVAL, "{} memory regions came with the message, not one", regionCount()));
      return nullptr;
    }
    int fd = regions_[0].get();
    // Only sealed memory cannot change under the daemon's feet: a file the
    // peer could still write would change the items between their checks and
    // their use, and one it could shrink would fault the reader.
    int seals = fcntl(fd, F_GET_SEALS);
    if (seals < 0) {
      QRVFail(error, QRV_POSIX_ERROR_QUIET(EINVAL, "the memory region is not a memory file"));
      return nullptr;
    }
    if ((seals & kSeals) != kSeals) {
      QRVFail(error, QRV_POSIX_ERROR_QUIET(EPERM, "the memory region is not sealed (seals {:#x})", seals));
      return nullptr;
    }
    struct stat st;
    if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
      QRVFail(error, QRV_POSIX_ERROR_QUIET(EINVAL, "the memory region is not a memory file"));
      return nullptr;
    }
    if (static_cast<uint64_t>(st.st_size) < size) {
      QRVFail(error, QRV_POSIX_ERROR_QUIET(EMSGSIZE, "the memory region holds {} bytes, not {}", st.st_size, size));
      return nullptr;
    }
    void* address = size == 0 ? MAP_FAILED : mmap(nullptr, size, PROT_READ, MAP_PRIVATE, fd, 0);
    if (address == MAP_FAILED) {
      int e = size == 0 ? EINVAL : errno;
      QRVFail(error, QRV_POSIX_ERROR_QUIET(e, "cannot map {} bytes of the memory region: {}", size, strerror(e)));
      return nullptr;
    }
    return std::make_unique<MappedRegion>(address, size);
  }

 private:
  const std::vector<uint8_t> message_;
  const size_t length_;
  const std::optional<QRVAuditToken> sender_;
  const std::vector<Descriptor> regions_;
  const bool regionsDropped_;
};

QRVLinuxUpcallTransport::QRVLinuxUpcallTransport(Options options)
    : options_(std::move(options)), shared_(std::make_shared<Shared>()) {}

QRVLinuxUpcallTransport::~QRVLinuxUpcallTransport() {
  shared_->stopping = true;
  if (shared_->wakeFd >= 0) {
    uint64_t one = 1;
    ssize_t ignored = write(shared_->wakeFd, &one, sizeof one);
    (void)ignored;
  }
  if (thread_.joinable()) thread_.join();
  // Requests already queued finish (and close what they hold) before the
  // handler's owner goes away.
  if (shared_->queue && !shared_->queue->isCurrent()) shared_->queue->sync([] {});
}

bool QRVLinuxUpcallTransport::checkIn(const std::string& name, std::shared_ptr<QRVSerialQueue> queue,
                                      Handler handler, QRVError* error) {
  if (thread_.joinable()) return QRVFail(error, QRV_POSIX_ERROR(EALREADY, "{} is already checked in", name));
  const std::string& path = options_.socketPath;
  sockaddr_un addr;
  if (!QRVUnixSocket::prepareToBind(path, &addr, error)) return false;

  Shared& s = *shared_;
  s.epollFd = epoll_create1(EPOLL_CLOEXEC);
  s.wakeFd = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  s.listenFd = socket(AF_UNIX, SOCK_SEQPACKET | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  if (s.epollFd < 0 || s.wakeFd < 0 || s.listenFd < 0)
    return QRVFail(error, QRV_POSIX_ERROR(errno, "cannot set up {}: {}", name, strerror(errno)));
  // The socket inode's mode before bind is the mode the path gets (less the
  // umask), so the path is never more open than 0660; the listen comes only
  // after owner and mode are final, so nobody connects before.
  gid_t group = options_.group.value_or(0);
  if (fchmod(s.listenFd, 0660) != 0 || bind(s.listenFd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0 ||
      lchown(path.c_str(), 0, group) != 0 || chmod(path.c_str(), 0660) != 0 || ::listen(s.listenFd, 64) != 0) {
    int e = errno;
    return QRVFail(error, QRV_POSIX_ERROR(e, "cannot listen on {}: {}", path, strerror(e)));
  }
  epoll_event ev{};
  ev.events = EPOLLIN;
  ev.data.u64 = kListenerTag;
  epoll_ctl(s.epollFd, EPOLL_CTL_ADD, s.listenFd, &ev);
  ev.data.u64 = kWakeTag;
  epoll_ctl(s.epollFd, EPOLL_CTL_ADD, s.wakeFd, &ev);
  s.queue = std::move(queue);
  s.handler = std::move(handler);
  thread_ = std::thread([this] { run(); });
  return true;
}

size_t QRVLinuxUpcallTransport::openConnections() const {
  QRVMutexLock lock(&shared_->mutex);
  return shared_->connections.size();
}

void QRVLinuxUpcallTransport::run() {
  epoll_event events[16];
  while (!shared_->stopping) {
    int n = epoll_wait(shared_->epollFd, events, 16, -1);
    if (n < 0 && errno != EINTR) {
      QRVLogError("upcall transport stops: epoll_wait failed: {}", strerror(errno));
      return;
    }
    for (int i = 0; i < n && !shared_->stopping; i++) {
      uint64_t tag = events[i].data.u64;
      if (tag == kWakeTag) continue;
      if (tag == kListenerTag) {
        acceptPending();
        continue;
      }
      std::shared_ptr<Connection> connection;
      {
        QRVMutexLock lock(&shared_->mutex);
        auto it = shared_->connections.find(tag);
        if (it != shared_->connections.end()) connection = it->second;
      }
      if (connection) receive(connection, events[i].events);
    }
  }
}

void QRVLinuxUpcallTransport::acceptPending() {
  static int64_t lastRefusalLog = 0;  // this thread only
  for (;;) {
    int fd = QRVUnixSocket::next(shared_->listenFd, "com.kelva.quorvad.upcall");
    if (fd < 0) return;
    ucred cred{};
    socklen_t len = sizeof cred;
    if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0) {
      // Without credentials the peer gets the trailer error on its request.
      cred = ucred{0, static_cast<uid_t>(-1), static_cast<gid_t>(-1)};
    }
    if (openConnections() >= options_.maxConnections) {
      ::close(fd);
      if (nowSeconds() != lastRefusalLog) {
        lastRefusalLog = nowSeconds();
        QRVLogError("refusing upcall connection from pid {} (uid {}): {} peers are connected", cred.pid, cred.uid,
                    options_.maxConnections);
      }
      continue;
    }
    int pidfd = cred.pid > 0 ? static_cast<int>(syscall(SYS_pidfd_open, cred.pid, 0)) : -1;
    QRVAuditToken token = QRVProcInfo::auditTokenForPeer(cred, pidfd);
    if (pidfd >= 0) ::close(pidfd);
    std::shared_ptr<Connection> connection;
    {
      QRVMutexLock lock(&shared_->mutex);
      uint64_t id = shared_->nextID++;
      connection = std::make_shared<Connection>(id, fd, cred, token);
      shared_->connections[id] = connection;
    }
    if (!connection->arm(shared_->epollFd, EPOLL_CTL_ADD)) shared_->forget(connection->id());
  }
}

void QRVLinuxUpcallTransport::receive(const std::shared_ptr<Connection>& connection, uint32_t events) {
  std::vector<uint8_t> bytes(QRVUpcallRequest::kMaxKeptBytes);
  std::vector<int> fds;
  bool dropped = false;
  // MSG_TRUNC: the real length of a longer message, whose rest is dropped.
  ssize_t n = QRVDescriptorPassing::receive(connection->fd(), bytes.data(), bytes.size(), MSG_DONTWAIT | MSG_TRUNC,
                                            &fds, &dropped);
  std::vector<Descriptor> regions(fds.begin(), fds.end());
  if (n < 0) {
    if (errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR) {
      if (!connection->arm(shared_->epollFd, EPOLL_CTL_MOD)) shared_->forget(connection->id());
    } else {
      QRVLogDebug("upcall connection of pid {} ends: {}", connection->credentials().pid, strerror(errno));
      shared_->forget(connection->id());
    }
    return;
  }
  // A message of no bytes reads like the end of the connection; the hang-up
  // tells them apart.
  if (n == 0 && (events & (EPOLLHUP | EPOLLRDHUP)) && regions.empty()) {
    shared_->forget(connection->id());
    return;
  }
  bytes.resize(std::min(static_cast<size_t>(n), bytes.size()));
  // Without credentials the request has no sender: the server answers that.
  std::optional<QRVAuditToken> sender;
  if (connection->credentials().uid != static_cast<uid_t>(-1)) sender = connection->token();
  auto request =
      std::make_shared<Request>(std::move(bytes), static_cast<size_t>(n), sender, std::move(regions), dropped);
  std::shared_ptr<Shared> shared = shared_;
  shared->queue->async([shared, connection, request]() mutable {
    std::optional<QRVUpcallReply> reply = shared->handler(*request);
    // The peer's descriptors are closed before the reply goes out.
    request.reset();
    bool keep = !reply || connection->send(*reply);
    if (keep && !shared->stopping && connection->arm(shared->epollFd, EPOLL_CTL_MOD)) return;
    shared->forget(connection->id());
  });
}

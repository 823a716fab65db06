#include "client/QRVClient.h"

#include <fmt/format.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <utility>

#include "base/QRVWireFrame.h"
#include "client/QRVProtocol.h"

namespace {

// Read in chunks this size; a reply larger than that is simply read in
// several goes.
constexpr size_t kReadChunk = 64 * 1024;

std::string errnoText(int errnum) { return std::strerror(errnum); }

}  // namespace

bool QRVClientError::daemonNotRunning() const { return errnum == ENOENT || errnum == ECONNREFUSED; }

// --- paths ----------------------------------------------------------------

std::string QRVClient::resolveRoot(const std::optional<std::string>& commandLineRoot) {
  if (commandLineRoot) return *commandLineRoot;
  const char* env = getenv("QUORVAD_ROOT");
  if (env && *env) return env;
  return "/";
}

std::string QRVClient::socketPathForRoot(const std::string& root) {
  std::string base = root.empty() ? std::string("/") : root;
  while (base.size() > 1 && base.back() == '/') base.pop_back();
  if (base == "/") base.clear();
  return base + "/run/quorvad/com.kelva.quorvad";
}

// --- lifetime -------------------------------------------------------------

QRVClient::QRVClient(int fd, std::string peer) : fd_(fd), peer_(std::move(peer)) {}

QRVClient QRVClient::adoptSocket(int fd, std::string description) {
  return QRVClient(fd, std::move(description));
}

QRVClient::QRVClient(QRVClient&& other) noexcept
    : fd_(std::exchange(other.fd_, -1)),
      peer_(std::move(other.peer_)),
      nextMessageId_(other.nextMessageId_),
      broken_(other.broken_),
      input_(std::move(other.input_)),
      kept_(std::move(other.kept_)) {}

QRVClient& QRVClient::operator=(QRVClient&& other) noexcept {
  if (this != &other) {
    if (fd_ >= 0) close(fd_);
    fd_ = std::exchange(other.fd_, -1);
    peer_ = std::move(other.peer_);
    nextMessageId_ = other.nextMessageId_;
    broken_ = other.broken_;
    input_ = std::move(other.input_);
    kept_ = std::move(other.kept_);
  }
  return *this;
}

QRVClient::~QRVClient() {
  if (fd_ >= 0) close(fd_);
}

std::optional<QRVClient> QRVClient::connect(const std::string& root, QRVClientError* error) {
  return connectToSocket(socketPathForRoot(root), error);
}

std::optional<QRVClient> QRVClient::connectToSocket(const std::string& socketPath,
                                                    QRVClientError* error) {
  int fd = connectUnixSocket(socketPath, SOCK_STREAM, error);
  if (fd < 0) return std::nullopt;
  return QRVClient(fd, socketPath);
}

int QRVClient::connectUnixSocket(const std::string& socketPath, int type, QRVClientError* error) {
  auto failed = [&](int errnum, std::string message) {
    if (error) *error = {errnum, std::move(message)};
    return -1;
  };

  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (socketPath.size() >= sizeof(address.sun_path))
    return failed(ENAMETOOLONG,
                  fmt::format("socket path too long for a Unix socket ({} bytes, "
                              "at most {}): {}",
                              socketPath.size(), sizeof(address.sun_path) - 1, socketPath));
  memcpy(address.sun_path, socketPath.c_str(), socketPath.size() + 1);

  int fd = socket(AF_UNIX, type | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    int e = errno;
    return failed(e, fmt::format("cannot create a socket: {}", errnoText(e)));
  }
  for (;;) {
    if (::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof(address)) == 0) break;
    int e = errno;
    // A connect interrupted by a signal goes on in the kernel; asking again
    // reports either its outcome or that it already succeeded.
    if (e == EINTR) continue;
    if (e == EISCONN) break;
    close(fd);
    if (e == ENOENT)
      return failed(e, fmt::format("quorvad is not running (no socket at {})", socketPath));
    if (e == ECONNREFUSED)
      return failed(e, fmt::format("quorvad is not running (nothing listening at {})", socketPath));
    return failed(e, fmt::format("cannot connect to quorvad at {}: {}", socketPath, errnoText(e)));
  }
  return fd;
}

// --- deadlines ------------------------------------------------------------

QRVClient::Deadline QRVClient::Deadline::after(std::chrono::milliseconds timeout) {
  Deadline d;
  // Anything beyond a few years is "forever"; it also keeps now() + timeout
  // from overflowing the clock's representation.
  if (timeout >= std::chrono::hours(24 * 365 * 10)) {
    d.unlimited = true;
    return d;
  }
  d.at = Clock::now() + std::max(timeout, std::chrono::milliseconds(0));
  return d;
}

int QRVClient::Deadline::pollTimeoutMs() const {
  if (unlimited) return -1;
  auto left = at - Clock::now();
  if (left <= Clock::duration::zero()) return 0;
  // Round up so a sub-millisecond remainder waits instead of spinning.
  auto ms = std::chrono::ceil<std::chrono::milliseconds>(left).count();
  return ms > INT_MAX ? INT_MAX : static_cast<int>(ms);
}

// --- errors ---------------------------------------------------------------

bool QRVClient::fail(QRVClientError* error, int errnum, std::string message,
                     bool breaksConnection) {
  if (breaksConnection) broken_ = true;
  if (error) *error = {errnum, std::move(message)};
  return false;
}

// --- sending --------------------------------------------------------------

bool QRVClient::writeAll(const uint8_t* bytes, size_t length, const Deadline& deadline,
                         QRVClientError* error) {
  size_t written = 0;
  while (written < length) {
    // MSG_DONTWAIT keeps a full socket buffer from blocking past the
    // deadline; MSG_NOSIGNAL turns a vanished daemon into EPIPE instead of
    // killing the caller with SIGPIPE.
    ssize_t n = ::send(fd_, bytes + written, length - written, MSG_DONTWAIT | MSG_NOSIGNAL);
    if (n > 0) {
      written += static_cast<size_t>(n);
      continue;
    }
    int e = errno;
    if (n < 0 && e == EINTR) continue;
    if (n < 0 && (e == EAGAIN || e == EWOULDBLOCK)) {
      pollfd p{fd_, POLLOUT, 0};
      int r = poll(&p, 1, deadline.pollTimeoutMs());
      int pollErrno = errno;
      if (r < 0 && pollErrno == EINTR) continue;
      if (r < 0) return fail(error, pollErrno, "poll failed: " + errnoText(pollErrno), true);
      if (r == 0) {
        // Part of a frame is out: the stream can no longer be resynchronised.
        return fail(error, ETIMEDOUT,
                    fmt::format("timed out sending a request to {} ({} of {} bytes sent)", peer_,
                                written, length),
                    written > 0);
      }
      continue;
    }
    if (e == EPIPE || e == ECONNRESET)
      return fail(error, ECONNRESET, fmt::format("quorvad closed the connection ({})", peer_),
                  true);
    return fail(error, e, fmt::format("cannot send to {}: {}", peer_, errnoText(e)), true);
  }
  return true;
}

std::optional<uint64_t> QRVClient::send(const QRVPlist& request, std::chrono::milliseconds timeout,
                                        QRVClientError* error) {
  if (broken_ || fd_ < 0) {
    fail(error, ENOTCONN, fmt::format("the connection to {} is no longer usable", peer_), false);
    return std::nullopt;
  }
  if (!request.isDictionary()) {
    fail(error, EINVAL, "a request must be a dictionary", false);
    return std::nullopt;
  }
  uint64_t id = nextMessageId_;
  std::vector<uint8_t> frame = QRVWireFrame::encode(request, QRVWireFrame::kFlagWantsReply, id);
  size_t body = frame.size() - QRVWireFrame::kHeaderSize;
  if (body > QRVWireFrame::kMaxBodySize) {
    fail(error, EMSGSIZE,
         fmt::format("request too large ({} bytes, at most {})", body, QRVWireFrame::kMaxBodySize),
         false);
    return std::nullopt;
  }
  if (!writeAll(frame.data(), frame.size(), Deadline::after(timeout), error)) return std::nullopt;
  nextMessageId_++;
  return id;
}

// --- receiving ------------------------------------------------------------

std::optional<QRVClient::Reply> QRVClient::readFrame(const Deadline& deadline,
                                                     QRVClientError* error) {
  using QRVWireFrame::kHeaderSize;
  for (;;) {
    if (input_.size() >= kHeaderSize) {
      QRVWireFrame::Header header = QRVWireFrame::decodeHeader(input_.data());
      if (header.length > QRVWireFrame::kMaxBodySize) {
        fail(error, EBADMSG,
             fmt::format("malformed reply from {}: header announces {} bytes, more than the limit "
                         "of {}",
                         peer_, header.length, QRVWireFrame::kMaxBodySize),
             true);
        return std::nullopt;
      }
      size_t total = kHeaderSize + header.length;
      if (input_.size() >= total) {
        auto body = QRVWireFrame::decodeBody(input_.data() + kHeaderSize, header.length);
        input_.erase(input_.begin(), input_.begin() + static_cast<std::ptrdiff_t>(total));
        if (!body) {
          fail(error, EBADMSG,
               fmt::format("malformed reply from {}: body of message {} is not a binary property "
                           "list with a dictionary at its root",
                           peer_, header.messageId),
               true);
          return std::nullopt;
        }
        return Reply{header.messageId, std::move(*body)};
      }
    }

    pollfd p{fd_, POLLIN, 0};
    int r = poll(&p, 1, deadline.pollTimeoutMs());
    int pollErrno = errno;
    if (r < 0 && pollErrno == EINTR) continue;
    if (r < 0) {
      fail(error, pollErrno, "poll failed: " + errnoText(pollErrno), true);
      return std::nullopt;
    }
    if (r == 0) {
      // What was read so far stays in input_: the next call finishes the frame.
      fail(error, ETIMEDOUT, fmt::format("timed out waiting for a reply from {}", peer_), false);
      return std::nullopt;
    }

    size_t old = input_.size();
    input_.resize(old + kReadChunk);
    ssize_t n = recv(fd_, input_.data() + old, kReadChunk, MSG_DONTWAIT);
    int e = errno;
    input_.resize(old + (n > 0 ? static_cast<size_t>(n) : 0));
    if (n > 0) continue;
    if (n < 0 && (e == EINTR || e == EAGAIN || e == EWOULDBLOCK)) continue;
    if (n == 0 || e == ECONNRESET) {
      fail(error, ECONNRESET,
           old > 0 ? fmt::format("quorvad closed the connection in the middle of a reply ({}; {} "
                                 "bytes of it received)",
                                 peer_, old)
                   : fmt::format("quorvad closed the connection ({})", peer_),
           true);
      return std::nullopt;
    }
    fail(error, e, fmt::format("cannot read from {}: {}", peer_, errnoText(e)), true);
    return std::nullopt;
  }
}

std::optional<QRVClient::Reply> QRVClient::takeKept(uint64_t messageId) {
  for (auto it = kept_.begin(); it != kept_.end(); ++it) {
    if (it->messageId == messageId) {
      Reply reply = std::move(*it);
      kept_.erase(it);
      return reply;
    }
  }
  return std::nullopt;
}

std::optional<QRVClient::Reply> QRVClient::receive(std::chrono::milliseconds timeout,
                                                   QRVClientError* error) {
  if (!kept_.empty()) {
    Reply reply = std::move(kept_.front());
    kept_.pop_front();
    return reply;
  }
  if (broken_ || fd_ < 0) {
    fail(error, ENOTCONN, fmt::format("the connection to {} is no longer usable", peer_), false);
    return std::nullopt;
  }
  return readFrame(Deadline::after(timeout), error);
}

std::optional<QRVPlist> QRVClient::receiveReply(uint64_t messageId,
                                                std::chrono::milliseconds timeout,
                                                QRVClientError* error) {
  if (auto kept = takeKept(messageId)) return std::move(kept->body);
  if (broken_ || fd_ < 0) {
    fail(error, ENOTCONN, fmt::format("the connection to {} is no longer usable", peer_), false);
    return std::nullopt;
  }
  Deadline deadline = Deadline::after(timeout);
  for (;;) {
    auto reply = readFrame(deadline, error);
    if (!reply) return std::nullopt;
    if (reply->messageId == messageId) return std::move(reply->body);
    kept_.push_back(std::move(*reply));
  }
}

std::optional<QRVPlist> QRVClient::sendRequest(const QRVPlist& request,
                                               std::chrono::milliseconds timeout,
                                               QRVClientError* error) {
  Deadline deadline = Deadline::after(timeout);
  auto id = send(request, timeout, error);
  if (!id) return std::nullopt;
  // What is left of the caller's budget after sending.
  std::chrono::milliseconds left = kNoTimeout;
  if (!deadline.unlimited)
    left = std::chrono::ceil<std::chrono::milliseconds>(
        std::max(deadline.at - Clock::now(), Clock::duration::zero()));
  return receiveReply(*id, left, error);
}

uint64_t QRVClient::resultCode(const QRVPlist& reply) {
  const QRVPlist* code = reply.get(QRVProtocol::kReplyErrorKey);
  return code && code->type() == QRVPlist::Type::UInteger ? code->uint64Value() : 0;
}

// A connection to quorvad over its Unix stream socket.
//
// The daemon answers every request with exactly one reply carrying the
// request's message id. Replies come back in request order except for the
// commands that finish asynchronously (deleteContainersOnDeathRow,
// setDataProtection), so this class matches replies by id and keeps any reply
// that arrives for another request until it is asked for.
//
// Usage:
//   QRVClientError error;
//   auto client = QRVClient::connect(QRVClient::resolveRoot(std::nullopt), &error);
//   if (!client) { fprintf(stderr, "%s\n", error.message.c_str()); ... }
//   QRVPlist request = QRVPlist::dictionary();
//   request.set("Command", QRVPlist::uinteger(0));
//   auto reply = client->sendRequest(request, std::chrono::seconds(5), &error);
//   if (reply && QRVClient::resultCode(*reply) == 1) ...
//
// The daemon identifies a caller by the credentials of the process that
// called connect() (SO_PEERCRED), not by whoever sends later: change uid
// before connecting, not after.
//
// Thread-safety: a QRVClient is not synchronised; use one from one thread at
// a time. There is no process-wide state, so separate instances in separate
// threads or forked children are independent. The socket is close-on-exec.
#pragma once

#include <chrono>
#include <cstdint>
#include <deque>
#include <optional>
#include <string>
#include <vector>

#include "base/QRVPlist.h"

// Why a client call failed. `errnum` classifies the failure with an errno
// value so callers can branch without parsing text; `message` is a complete
// sentence for a human (it names the socket path where that helps).
//   ENOENT, ECONNREFUSED  the daemon is not running (no socket / nobody listening)
//   ETIMEDOUT             the deadline passed before the message went out or
//                         the reply came in
//   ECONNRESET            the daemon closed the connection (also mid-reply)
//   EBADMSG               the daemon sent something that is not a valid reply
//                         (header over the size limit, body not a dictionary)
//   EMSGSIZE              the request is too large to send
//   ENOTCONN              the connection was already broken by an earlier error
//   other                 the errno of a failed system call
struct QRVClientError {
  int errnum = 0;
  std::string message;

  // True when the daemon could not be reached at all.
  bool daemonNotRunning() const;
};

class QRVClient {
 public:
  // Passed as a timeout: wait without limit.
  static constexpr std::chrono::milliseconds kNoTimeout = std::chrono::milliseconds::max();

  struct Reply {
    uint64_t messageId = 0;
    QRVPlist body;  // always a dictionary
  };

  // The root directory every path is taken relative to: `commandLineRoot`
  // when given, else the environment variable QUORVAD_ROOT when set and not
  // empty, else "/".
  static std::string resolveRoot(const std::optional<std::string>& commandLineRoot);
  // "<root>/run/quorvad/com.kelva.quorvad", without doubled slashes.
  static std::string socketPathForRoot(const std::string& root);

  // Connects to the daemon serving `root`. On failure returns nothing and
  // fills `error` (may be null): ENOENT / ECONNREFUSED read
  // "quorvad is not running (...)".
  static std::optional<QRVClient> connect(const std::string& root, QRVClientError* error);
  // Same, given the socket path itself.
  static std::optional<QRVClient> connectToSocket(const std::string& socketPath,
                                                  QRVClientError* error);
  // A close-on-exec Unix socket of `type` connected to `socketPath`, or -1
  // with `error` filled as connect() fills it.
  static int connectUnixSocket(const std::string& socketPath, int type, QRVClientError* error);
  // Takes ownership of an already connected stream socket (for example one
  // end of a socketpair). `description` names the peer in error messages.
  static QRVClient adoptSocket(int fd, std::string description = "quorvad");

  QRVClient(QRVClient&& other) noexcept;
  QRVClient& operator=(QRVClient&& other) noexcept;
  QRVClient(const QRVClient&) = delete;
  QRVClient& operator=(const QRVClient&) = delete;
  ~QRVClient();

  // Sends `request` (a dictionary) as a request wanting a reply and waits for
  // the reply with its id. `timeout` bounds the whole call. On success
  // returns the reply's dictionary; on failure returns nothing and fills
  // `error`. Replies to other requests that arrive meanwhile are kept for
  // receive()/receiveReply().
  std::optional<QRVPlist> sendRequest(const QRVPlist& request, std::chrono::milliseconds timeout,
                                      QRVClientError* error);

  // Pipelining: send() writes one request and returns its message id without
  // waiting for the reply; receive() returns the next reply in arrival order
  // (kept ones first); receiveReply() returns the reply to `messageId`,
  // keeping any other it reads on the way.
  //
  // A timeout while waiting for a reply leaves the connection usable (a
  // partly read reply is kept and completed by the next call). A timeout in
  // the middle of sending a request, a closed connection or a malformed
  // reply break the connection: every later call fails with ENOTCONN.
  std::optional<uint64_t> send(const QRVPlist& request, std::chrono::milliseconds timeout,
                               QRVClientError* error);
  std::optional<Reply> receive(std::chrono::milliseconds timeout, QRVClientError* error);
  std::optional<QRVPlist> receiveReply(uint64_t messageId, std::chrono::milliseconds timeout,
                                       QRVClientError* error);

  // The reply's "ReplyError"; 0 when it is absent or not a number (the daemon
  // always sets it, so 0 means a broken reply). 1 is success.
  static uint64_t resultCode(const QRVPlist& reply);

  // The socket, for poll() in an event loop; still owned by this object.
  int fd() const { return fd_; }
  // The path connected to, or the description given to adoptSocket().
  const std::string& peerDescription() const { return peer_; }
  bool isBroken() const { return broken_; }

 private:
  using Clock = std::chrono::steady_clock;
  struct Deadline {
    bool unlimited = false;
    Clock::time_point at;
    static Deadline after(std::chrono::milliseconds timeout);
    int pollTimeoutMs() const;  // -1 = unlimited, 0 when already past
  };

  QRVClient(int fd, std::string peer);

  bool writeAll(const uint8_t* bytes, size_t length, const Deadline& deadline,
                QRVClientError* error);
  // Reads until one whole frame is buffered, then decodes it.
  std::optional<Reply> readFrame(const Deadline& deadline, QRVClientError* error);
  std::optional<Reply> takeKept(uint64_t messageId);
  bool fail(QRVClientError* error, int errnum, std::string message, bool breaksConnection);

  int fd_ = -1;
  std::string peer_;
  uint64_t nextMessageId_ = 1;
  bool broken_ = false;
  std::vector<uint8_t> input_;  // bytes read but not yet decoded into a frame
  std::deque<Reply> kept_;      // replies read ahead, in arrival order
};

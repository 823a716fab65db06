// The platform message service: a listening service whose clients send
// dictionary messages and receive replies.
//
// Events of one connection are delivered one after another, on one thread at
// a time; different connections are served concurrently. New connections are
// announced on the queue given to `listen`, so a service that starts serving
// only after that queue has finished earlier work (start-up) gets that
// ordering for free.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "base/QRVError.h"
#include "base/QRVPlist.h"
#include "base/QRVSerialQueue.h"
#include "platform/QRVAuditToken.h"

class QRVConnection;

// One received message. `hasReplyContext` is set when the sender asked for a
// reply.
struct QRVMessage {
  QRVPlist body;
  uint64_t messageId = 0;
  bool hasReplyContext = false;
  std::weak_ptr<QRVConnection> connection;
};

// What a connection's event handler receives: a message, or the news that the
// connection is no longer usable (the peer left or the daemon closed it).
struct QRVConnectionEvent {
  enum class Kind { kMessage, kConnectionInvalid };
  Kind kind = Kind::kMessage;
  QRVMessage message;
};

// A reply under construction. It keeps only a weak reference to its
// connection, so a reply that is sent late (by an asynchronous completion)
// after the peer has gone is dropped quietly.
class QRVReply {
 public:
  // Fails (returns null) when the message carries no reply context.
  static std::shared_ptr<QRVReply> createFrom(const QRVMessage& request);

  QRVPlist& dictionary() { return dictionary_; }
  // Sends the reply; a second call does nothing.
  void send();

 private:
  QRVReply(uint64_t messageId, std::weak_ptr<QRVConnection> connection)
      : messageId_(messageId), connection_(std::move(connection)) {}

  const uint64_t messageId_;
  const std::weak_ptr<QRVConnection> connection_;
  QRVPlist dictionary_ = QRVPlist::dictionary();
  bool sent_ = false;
};

// What a peer process can change about itself after it connected, as far as
// the trust store and the sandbox facility look at it: the executable it
// runs (an exec replaces it) and whether it has confined itself (which it
// can never undo). Everything else they read is fixed for the connection's
// life (its credentials) or belongs to them (their own configuration).
struct QRVPeerProcessState {
  uint64_t executableDevice = 0;
  uint64_t executableInode = 0;
  bool confined = false;
  bool operator==(const QRVPeerProcessState&) const = default;
};

class QRVConnection : public std::enable_shared_from_this<QRVConnection> {
 public:
  using EventHandler =
      std::function<void(const std::shared_ptr<QRVConnection>&, const QRVConnectionEvent&)>;

  virtual ~QRVConnection() = default;

  virtual pid_t pid() const = 0;
  virtual uid_t euid() const = 0;
  virtual gid_t egid() const = 0;
  virtual const QRVAuditToken& auditToken() const = 0;
  // The persona the peer runs in, if any.
  virtual std::optional<uint32_t> personaID() const = 0;
  // The peer's state now, read through descriptors kept for the connection
  // (one or two system calls, no lock). None when the peer has exited, or
  // when the platform cannot tell: the caller must then identify the peer
  // from scratch. Called by one thread at a time, like the event handler.
  virtual std::optional<QRVPeerProcessState> peerProcessState() { return std::nullopt; }

  // Installs the handler; must precede `resume`.
  virtual void setEventHandler(EventHandler handler) = 0;
  // Starts delivering events.
  virtual void resume() = 0;
  // Closes the connection; no further events are delivered.
  virtual void cancel() = 0;
  // Queues `reply` for request `messageId`. Any thread may call it.
  virtual void sendReply(uint64_t messageId, const QRVPlist& reply) = 0;
};

class QRVMessageService {
 public:
  using ConnectionHandler = std::function<void(const std::shared_ptr<QRVConnection>&)>;

  virtual ~QRVMessageService() = default;

  // Starts listening on the service `name`. `onConnection` runs on `queue`
  // for every new connection; it installs an event handler and resumes the
  // connection.
  virtual bool listen(const std::string& name, std::shared_ptr<QRVSerialQueue> queue,
                      ConnectionHandler onConnection, QRVError* error) = 0;

  // Keep-alive transactions: while any is open, or any connection is, the
  // daemon is not idle.
  virtual void beginTransaction() = 0;
  virtual void endTransaction() = 0;
  virtual bool isIdle() const = 0;
};

// Opens a keep-alive transaction for the object's lifetime.
class QRVTransaction {
 public:
  explicit QRVTransaction(QRVMessageService& service) : service_(service) { service_.beginTransaction(); }
  ~QRVTransaction() { service_.endTransaction(); }
  QRVTransaction(const QRVTransaction&) = delete;
  QRVTransaction& operator=(const QRVTransaction&) = delete;

 private:
  QRVMessageService& service_;
};

// The upcall transport over a Unix-domain SOCK_SEQPACKET socket.
//
// A peer connects and sends one message per request, with its memory region
// as one sealed memfd passed by SCM_RIGHTS; the reply comes back the same
// way on the same connection. The sender's credentials are the socket's peer
// credentials (SO_PEERCRED), read when the peer connects.
//
// One thread waits on all connections. A connection is read one message at a
// time: after a message it is not read again until that message has been
// answered, so a peer can never have more than one request (and its
// descriptors) inside the daemon. At most `maxConnections` peers are
// connected at once; more are accepted and closed at once. A peer that
// closes before its reply, or whose socket will not take the reply, is
// dropped without affecting anyone else.
//
// The socket is created with mode 0660, owned by root and by the group
// `group` when given (root's otherwise), before it starts listening: it is
// never reachable by anyone else, not even for a moment.
#pragma once

#include <sys/types.h>

#include <atomic>
#include <memory>
#include <optional>
#include <string>
#include <thread>

#include "platform/QRVUpcallTransport.h"

class QRVLinuxUpcallTransport : public QRVUpcallTransport {
 public:
  struct Options {
    std::string socketPath;
    std::optional<gid_t> group;
    size_t maxConnections = 64;
  };

  explicit QRVLinuxUpcallTransport(Options options);
  // Stops reading and waits for requests already on the queue to finish.
  // Must not run on that queue.
  ~QRVLinuxUpcallTransport() override;

  bool checkIn(const std::string& name, std::shared_ptr<QRVSerialQueue> queue, Handler handler,
               QRVError* error) override;

  size_t openConnections() const;

 private:
  struct Shared;
  class Connection;
  class Request;

  void run();
  void acceptPending();
  void receive(const std::shared_ptr<Connection>& connection, uint32_t events);

  const Options options_;
  // What the queued requests need after this object may be gone.
  std::shared_ptr<Shared> shared_;
  std::thread thread_;
};

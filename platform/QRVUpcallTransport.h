// The kernel upcall transport: a port on which container-path requests
// arrive as small fixed-layout messages, each with one region of memory
// handed over beside it, and on which each request is answered once.
//
// The transport knows nothing of the messages' layout: it delivers what a
// peer sent, with the peer's credentials, and sends back what the handler
// answers. Checking the message is the server's work.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/QRVError.h"
#include "base/QRVSerialQueue.h"
#include "platform/QRVAuditToken.h"

// Memory a peer handed over, mapped read-only for as long as this object
// lives. The peer can no longer change or shrink it.
class QRVUpcallMemory {
 public:
  virtual ~QRVUpcallMemory() = default;
  virtual const uint8_t* bytes() const = 0;
  virtual size_t size() const = 0;
};

// One received message. Valid until the handler returns.
class QRVUpcallRequest {
 public:
  // Bytes of a message beyond this many are not kept (the length still
  // says how long it was).
  static constexpr size_t kMaxKeptBytes = 64;

  virtual ~QRVUpcallRequest() = default;
  // The message's first bytes, at most kMaxKeptBytes of them.
  virtual const std::vector<uint8_t>& message() const = 0;
  // How many bytes the peer sent.
  virtual size_t messageLength() const = 0;
  // The sender's credentials; none when the transport could not read them.
  virtual std::optional<QRVAuditToken> sender() const = 0;
  // How many memory regions came with the message.
  virtual size_t regionCount() const = 0;
  // Maps the first `size` bytes of the message's one region. Fails (POSIX
  // domain) with EINVAL unless exactly one region came and it is sealed
  // memory, EPERM when it is not sealed against writing, growing and
  // shrinking, EMSGSIZE when it holds fewer than `size` bytes, and with the
  // mapping's errno (`size` 0 included). Bytes beyond `size` are never read.
  virtual std::unique_ptr<QRVUpcallMemory> mapRegion(size_t size, QRVError* error) = 0;
};

// What to send back: a message and, when present, the bytes of the one
// region that goes with it.
struct QRVUpcallReply {
  std::vector<uint8_t> message;
  std::optional<std::vector<uint8_t>> region;
};

class QRVUpcallTransport {
 public:
  // Answers one request; nothing means no reply is sent.
  using Handler = std::function<std::optional<QRVUpcallReply>(QRVUpcallRequest& request)>;

  virtual ~QRVUpcallTransport() = default;
  // Checks in the service `name` and serves its requests one at a time on
  // `queue`, each answered before the next of the same peer is read. False
  // (with the error) when the service cannot be offered.
  virtual bool checkIn(const std::string& name, std::shared_ptr<QRVSerialQueue> queue, Handler handler,
                       QRVError* error) = 0;
};

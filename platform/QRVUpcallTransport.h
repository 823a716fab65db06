// The kernel upcall transport: a port on which container-path requests
// arrive as fixed-size messages with one out-of-line memory region.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>

#include "base/QRVError.h"
#include "base/QRVSerialQueue.h"
#include "platform/QRVAuditToken.h"

class QRVUpcallTransport {
 public:
  struct Request {
    uint32_t messageId = 0;
    const uint8_t* bytes = nullptr;  // the out-of-line region, mapped
    size_t length = 0;
    QRVAuditToken sender;
  };
  // Returns the reply bytes to send back (empty for an error reply) and the
  // return code.
  using Handler = std::function<int(const Request&, std::vector<uint8_t>* reply)>;

  virtual ~QRVUpcallTransport() = default;
  // Checks in the service and serves requests on `queue`.
  virtual bool checkIn(const std::string& name, std::shared_ptr<QRVSerialQueue> queue, Handler handler,
                       QRVError* error) = 0;
};

// The kernel container-path service: answers the sandbox's requests for a
// process's container paths. Its queue targets the listener queue, so upcalls
// and new connections never run at the same time.
#pragma once

#include <memory>

#include "base/QRVSerialQueue.h"
#include "core/QRVServices.h"

class QRVUpcallServer {
 public:
  explicit QRVUpcallServer(std::shared_ptr<QRVServices> services) : services_(std::move(services)) {}

  // Starts serving, once. Returns false when the service cannot be checked
  // in (the daemon cannot run without it).
  bool start(std::shared_ptr<QRVSerialQueue> targetQueue);

 private:
  std::shared_ptr<QRVServices> services_;
  std::shared_ptr<QRVSerialQueue> queue_;
};

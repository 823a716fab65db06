// The kernel container-path service: answers a sandbox launcher's requests
// for the container paths of a process it starts. Its queue targets the
// listener queue, so upcalls and new connections never run at the same time;
// upcalls themselves are served one at a time.
//
// Every message gets exactly one reply, with the request's id plus 100:
//   -303  an id this service has no routine for
//   -300  not a request: wrong size or bits, not one memory descriptor, a
//         descriptor size that disagrees with the count, a region over
//         kMaxRegionSize, or a region that is missing, doubled, unsealed or
//         shorter than claimed
//   -309  no sender credentials
//   55    the sender is neither root nor holds kEntitlement (logged)
//   4, 5, 9  the routine's statuses (QRVProcessContainers)
// and otherwise the reply describing the packed paths.
#pragma once

#include <memory>

#include "base/QRVSerialQueue.h"
#include "base/QRVUpcallMessage.h"
#include "core/QRVServices.h"
#include "platform/QRVUpcallTransport.h"
#include "upcall/QRVProcessContainers.h"

class QRVUpcallServer {
 public:
  static constexpr const char* kServiceName = "com.kelva.quorvad.upcall";
  // What a peer other than root must hold (as a true boolean) to be served:
  // the paths of any application's containers are not every process's to
  // know.
  static constexpr const char* kEntitlement = "com.kelva.private.Quorva.kernelUpcall";
  // A request's packed buffer names one process; more than this is refused
  // before it is mapped.
  static constexpr uint32_t kMaxRegionSize = 1u << 20;

  explicit QRVUpcallServer(std::shared_ptr<QRVServices> services)
      : services_(services), processContainers_(std::move(services)) {}

  // Checks the service in and starts serving, once, on a queue of its own
  // targeted at `targetQueue` (may be null). False when the service cannot
  // be checked in: the daemon cannot run without it.
  bool QRVKernServerStart(std::shared_ptr<QRVSerialQueue> targetQueue);

  // Answers one message in `reply`. Returns false for a message that is not
  // this service's (its reply then says so).
  bool demux_server(QRVUpcallRequest& request, QRVUpcallReply* reply);

 private:
  // The one routine: checks the message and its sender, reads the request's
  // packed buffer and answers it.
  QRVUpcallReply server_get_process_containers(const QRVUpcallMessage::Header& header, QRVUpcallRequest& request);
  bool _senderMayAsk(const QRVAuditToken& sender);

  const std::shared_ptr<QRVServices> services_;
  QRVProcessContainers processContainers_;
  std::shared_ptr<QRVSerialQueue> queue_;
};

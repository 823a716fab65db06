#include "upcall/QRVUpcallServer.h"

#include "base/QRVLog.h"

bool QRVUpcallServer::start(std::shared_ptr<QRVSerialQueue> targetQueue) {
  if (queue_) return true;
  queue_ = QRVSerialQueue::create("com.kelva.quorvad.upcall", std::move(targetQueue));
  // The packed-buffer transport is not wired in yet: no kernel requests are
  // served, and start-up goes on.
  QRVLogNotice("kernel upcall server does nothing yet: container-path requests are not served");
  return true;
}

#include "upcall/QRVUpcallServer.h"

#include "base/QRVLog.h"

namespace M = QRVUpcallMessage;

bool QRVUpcallServer::QRVKernServerStart(std::shared_ptr<QRVSerialQueue> targetQueue) {
  if (queue_) return true;
  QRVUpcallTransport* transport = services_->platform.upcall.get();
  if (!transport) {
    QRVLogError("bootstrap_check_in: {}", "no upcall transport");
    return false;
  }
  auto queue = QRVSerialQueue::create(kServiceName, std::move(targetQueue));
  QRVError error;
  bool checkedIn = transport->checkIn(
      kServiceName, queue,
      [this](QRVUpcallRequest& request) {
        QRVUpcallReply reply;
        demux_server(request, &reply);
        return std::optional<QRVUpcallReply>(std::move(reply));
      },
      &error);
  if (!checkedIn) {
    QRVLogError("bootstrap_check_in: {}", error.message());
    return false;
  }
  queue_ = std::move(queue);
  return true;
}

bool QRVUpcallServer::demux_server(QRVUpcallRequest& request, QRVUpcallReply* reply) {
  const std::vector<uint8_t>& message = request.message();
  // A message too short for a header is answered as if its id were 0.
  M::Header header = M::decodeHeader(message.data(), message.size()).value_or(M::Header{});
  QRVLogDebug("in demux_server(); request->msgh_id: {}", static_cast<int32_t>(header.id));
  if (message.size() < M::kHeaderSize) {
    QRVLogError("upcall message of {} bytes has no header", request.messageLength());
    reply->message = M::encodeErrorReply(header, M::kTypeError);
    return true;
  }
  if (header.id != M::kGetProcessContainersID && header.id != M::kUnservedID) {
    reply->message = M::encodeErrorReply(header, M::kBadID);
    return false;
  }
  if (header.id == M::kUnservedID) {
    reply->message = M::encodeErrorReply(header, M::kBadID);
    return true;
  }
  QRVLogDebug("handling incomming request for quorva server");
  *reply = server_get_process_containers(header, request);
  if (std::optional<int32_t> code = M::decodeReturnCode(reply->message.data(), reply->message.size()))
    QRVLogDebug("quorva server returns: {}", *code);
  else
    QRVLogDebug("quorva server returns: 0");
  return true;
}

QRVUpcallReply QRVUpcallServer::server_get_process_containers(const M::Header& header, QRVUpcallRequest& request) {
  auto refuse = [&](int32_t code) { return QRVUpcallReply{M::encodeErrorReply(header, code), std::nullopt}; };

  const std::vector<uint8_t>& message = request.message();
  std::optional<M::Complex> complex = request.messageLength() == M::kMessageSize
                                          ? M::decodeComplex(message.data(), message.size())
                                          : std::nullopt;
  if (!complex || !(complex->header.bits & M::kComplex) || complex->header.size != M::kMessageSize ||
      complex->descriptorCount != 1 || complex->descriptorSize != complex->count) {
    QRVLogError("upcall request refused: not a request of {} bytes with one memory descriptor ({} bytes sent)",
                M::kMessageSize, request.messageLength());
    return refuse(M::kTypeError);
  }
  std::optional<QRVAuditToken> sender = request.sender();
  if (!sender) {
    QRVLogError("upcall request refused: the sender's credentials are unknown");
    return refuse(M::kTrailerError);
  }
  if (!_senderMayAsk(*sender)) return refuse(M::kNotEntitled);
  if (complex->descriptorSize > kMaxRegionSize) {
    QRVLogError("upcall request refused: {} bytes of request from pid {} exceed the limit of {}",
                complex->descriptorSize, sender->pid(), kMaxRegionSize);
    return refuse(M::kTypeError);
  }
  if (request.regionCount() != 1) {
    QRVLogError("upcall request refused: pid {} sent {} memory regions, not one", sender->pid(), request.regionCount());
    return refuse(M::kTypeError);
  }
  std::unique_ptr<QRVUpcallMemory> region;
  if (complex->descriptorSize > 0) {
    QRVError error;
    region = request.mapRegion(complex->descriptorSize, &error);
    if (!region) {
      QRVLogError("upcall request refused: pid {}: {}", sender->pid(), error.message());
      return refuse(M::kTypeError);
    }
  }

  std::vector<uint8_t> items;
  int32_t status = processContainers_.replyForRequest(region ? region->bytes() : nullptr,
                                                      region ? region->size() : 0, &items);
  // The request's memory goes back before the answer is sent.
  region.reset();
  if (status != 0) return refuse(status);
  uint32_t size = static_cast<uint32_t>(items.size());
  return QRVUpcallReply{M::encodeReply(header, size), std::move(items)};
}

bool QRVUpcallServer::_senderMayAsk(const QRVAuditToken& sender) {
  if (sender.uid() == 0) return true;
  std::optional<QRVPlist> entitlements = services_->platform.trustStore->entitlementsForAuditToken(sender);
  const QRVPlist* value = entitlements ? entitlements->get(kEntitlement) : nullptr;
  if (value && value->type() == QRVPlist::Type::Boolean && value->boolValue()) return true;
  QRVLogError("upcall from pid {} (uid {}) refused: it is neither root nor entitled to {}", sender.pid(),
              sender.uid(), kEntitlement);
  return false;
}

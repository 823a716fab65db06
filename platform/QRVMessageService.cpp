#include "platform/QRVMessageService.h"

std::shared_ptr<QRVReply> QRVReply::createFrom(const QRVMessage& request) {
  if (!request.hasReplyContext) return nullptr;
  return std::shared_ptr<QRVReply>(new QRVReply(request.messageId, request.connection));
}

void QRVReply::send() {
  if (sent_) return;
  sent_ = true;
  if (auto connection = connection_.lock()) connection->sendReply(messageId_, dictionary_);
}

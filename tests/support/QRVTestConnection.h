// A connection that records what the daemon sends, for tests of the code
// above the message service.
#pragma once

#include <mutex>
#include <utility>
#include <vector>

#include "platform/QRVMessageService.h"

class QRVTestConnection : public QRVConnection {
 public:
  // `startTime` as in a real audit token, for tests whose peer is a live
  // process.
  explicit QRVTestConnection(pid_t pid, uid_t uid = 501, gid_t gid = 501, uint64_t startTime = 1)
      : pid_(pid), uid_(uid), gid_(gid), token_(QRVAuditToken::make(uid, gid, pid, startTime)) {}

  pid_t pid() const override { return pid_; }
  uid_t euid() const override { return uid_; }
  gid_t egid() const override { return gid_; }
  const QRVAuditToken& auditToken() const override { return token_; }
  std::optional<uint32_t> personaID() const override { return persona; }
  std::optional<QRVPeerProcessState> peerProcessState() override { return state; }
  void setEventHandler(EventHandler) override {}
  void resume() override {}
  void cancel() override { cancelled = true; }
  void sendReply(uint64_t messageId, const QRVPlist& reply) override {
    std::lock_guard<std::mutex> lock(mutex_);
    replies.emplace_back(messageId, reply);
  }

  // A message from this peer, asking for a reply unless told otherwise.
  QRVConnectionEvent message(QRVPlist body, uint64_t id = 1, bool wantsReply = true) {
    QRVConnectionEvent e;
    e.message.body = std::move(body);
    e.message.messageId = id;
    e.message.hasReplyContext = wantsReply;
    e.message.connection = weak_from_this();
    return e;
  }

  std::optional<uint32_t> persona;
  // What the peer's process looks like now; none (the default) keeps the
  // daemon from keeping anything between requests.
  std::optional<QRVPeerProcessState> state;
  bool cancelled = false;
  std::vector<std::pair<uint64_t, QRVPlist>> replies;

 private:
  std::mutex mutex_;
  const pid_t pid_;
  const uid_t uid_;
  const gid_t gid_;
  const QRVAuditToken token_;
};

// The message service over a Unix-domain stream socket.
//
// A small pool of worker threads shares one epoll instance. Each connection
// is armed one-shot, so exactly one worker owns it at a time: that worker
// reads its frames, runs the event handler for each request on its own
// thread and writes the reply, with no hand-off between threads on the
// request path. A connection whose replies are not being read stops being
// read from (its requests wait in the kernel) and is closed when it makes no
// progress for `writeStallTimeout`. A client that starts a frame must finish
// it within `readStallTimeout`, or it is closed: a peer trickling bytes would
// otherwise hold its connection (and its buffer) for ever. A connection that
// sits idle between frames is not timed out (clients keep one connection for
// their whole life); what bounds those is `maxConnections`, beyond which new
// connections are accepted and closed at once. Any frame that breaks the
// protocol closes only its own connection.
#pragma once

#include <sys/socket.h>

#include <atomic>
#include <chrono>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "base/QRVMutex.h"
#include "platform/QRVMessageService.h"

class QRVLinuxMessageService : public QRVMessageService {
 public:
  struct Options {
    // Where to bind when the socket is not handed over by systemd.
    std::string socketPath;
    size_t workerThreads = 4;
    std::chrono::milliseconds writeStallTimeout{30'000};
    // How long a frame may take from its first byte to its last.
    std::chrono::milliseconds readStallTimeout{30'000};
    // Open connections beyond which new ones are refused.
    size_t maxConnections = 256;
  };

  explicit QRVLinuxMessageService(Options options);
  ~QRVLinuxMessageService() override;

  bool listen(const std::string& name, std::shared_ptr<QRVSerialQueue> queue,
              ConnectionHandler onConnection, QRVError* error) override;
  void beginTransaction() override;
  void endTransaction() override;
  bool isIdle() const override;

  size_t openConnections() const;

 private:
  class Connection;
  friend class Connection;

  bool openListeningSocket(const std::string& name, QRVError* error);
  void workerLoop();
  void acceptPending();
  void refuseAtBound(const ucred& cred);
  void handleConnectionEvent(uint64_t id, uint32_t events);
  void sweepStalledConnections();
  void forget(uint64_t id);
  std::shared_ptr<Connection> find(uint64_t id) const;

  const Options options_;
  int epollFd_ = -1;
  int listenFd_ = -1;
  int wakeFd_ = -1;
  std::shared_ptr<QRVSerialQueue> listenerQueue_;
  ConnectionHandler onConnection_;

  mutable QRVMutex mutex_;
  std::map<uint64_t, std::shared_ptr<Connection>> connections_ GUARDED_BY(mutex_);
  uint64_t nextConnectionId_ GUARDED_BY(mutex_) = 1;

  std::atomic<long> transactions_{0};
  std::atomic<bool> stopping_{false};
  std::atomic<int64_t> lastSweep_{0};
  // Refusals at the connection bound are logged at most once a second.
  int64_t lastRefusalLog_ = 0;    // listener queue only
  uint64_t refusedSinceLog_ = 0;  // listener queue only
  std::vector<std::thread> workers_;
};

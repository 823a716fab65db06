// Deferred steps of one request.
//
// Handlers and services append commands that must happen after a request's
// main work but before its reply (moving containers to death row, dropping
// records). The dispatcher drains the queue, in order, after the handler
// returns; the first failing command stops the drain and its code becomes
// the request's result.
//
// Any thread may insert, including a command running from this queue: the
// array has its own lock, and commands run one at a time on the queue's
// serial queue.
#pragma once

#include <cstdint>
#include <deque>
#include <memory>
#include <vector>

#include "base/QRVMutex.h"
#include "base/QRVSerialQueue.h"

class QRVCommandQueue;

class QRVCommand {
 public:
  virtual ~QRVCommand() = default;
  // The command's type number, for logs.
  virtual uint64_t command() const = 0;
  // Performs the command. On failure returns false and stores an error code
  // through `result`. `queue` is the queue it runs from; it may append more.
  virtual bool fromQueue(QRVCommandQueue& queue, uint64_t* result) = 0;
};

class QRVCommandQueue {
 public:
  QRVCommandQueue();

  void insertCommand(std::shared_ptr<QRVCommand> command);
  // Runs the oldest command. Returns true if one ran and succeeded; when
  // none was left, stores QRVResultCode::kQueueExhausted, which never
  // reaches a client.
  bool executeNextCommandWithError(uint64_t* result);
  // Runs commands until none is left (true; `result` untouched) or one fails
  // (false; its code stored through `result`; the rest are dropped).
  bool executeAllUntilExhaustedOrError(uint64_t* result);

  size_t pendingCount();
  // The commands waiting, oldest first, for tests to inspect.
  std::vector<std::shared_ptr<QRVCommand>> TEST_pendingCommands();

 private:
  std::shared_ptr<QRVSerialQueue> queue_;
  QRVMutex mutex_;
  std::deque<std::shared_ptr<QRVCommand>> commands_ GUARDED_BY(mutex_);
};

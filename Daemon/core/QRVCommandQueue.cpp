#include "core/QRVCommandQueue.h"

#include "base/QRVLog.h"
#include "base/QRVResultCode.h"

QRVCommandQueue::QRVCommandQueue() : queue_(QRVSerialQueue::create("com.kelva.quorvad.QRVCommandQueue")) {}

void QRVCommandQueue::insertCommand(std::shared_ptr<QRVCommand> command) {
  uint64_t type = command->command();
  const void* address = command.get();
  {
    QRVMutexLock lock(&mutex_);
    commands_.push_back(std::move(command));
  }
  QRVLogInfo("Added command <{}; {}> to queue", address, type);
}

bool QRVCommandQueue::executeNextCommandWithError(uint64_t* result) {
  std::shared_ptr<QRVCommand> command;
  {
    QRVMutexLock lock(&mutex_);
    if (!commands_.empty()) {
      command = std::move(commands_.front());
      commands_.pop_front();
    }
  }
  if (!command) {
    if (result) *result = QRVResultCode::kQueueExhausted;
    return false;
  }
  // A command that fails without storing a code leaves 0, which the
  // dispatcher answers as an internal error rather than as success.
  uint64_t code = 0;
  bool success = false;
  queue_->sync([&] {
    QRVLogInfo("Executing command <{}; {}>...", static_cast<const void*>(command.get()), command->command());
    success = command->fromQueue(*this, &code);
    QRVLogInfo("Completed command <{}; {}>: success = {}, error = {}", static_cast<const void*>(command.get()),
               command->command(), success ? 1 : 0, code);
  });
  if (!success && result) *result = code;
  return success;
}

bool QRVCommandQueue::executeAllUntilExhaustedOrError(uint64_t* result) {
  uint64_t code = QRVResultCode::kSuccess;
  while (executeNextCommandWithError(&code)) {
  }
  if (code == QRVResultCode::kQueueExhausted) return true;
  if (result) *result = code;
  // The commands after a failure belong to a request that has failed. They
  // are destroyed outside the lock, which their destructors may want.
  std::deque<std::shared_ptr<QRVCommand>> dropped;
  {
    QRVMutexLock lock(&mutex_);
    dropped.swap(commands_);
  }
  return false;
}

size_t QRVCommandQueue::pendingCount() {
  QRVMutexLock lock(&mutex_);
  return commands_.size();
}

std::vector<std::shared_ptr<QRVCommand>> QRVCommandQueue::TEST_pendingCommands() {
  QRVMutexLock lock(&mutex_);
  return std::vector<std::shared_ptr<QRVCommand>>(commands_.begin(), commands_.end());
}

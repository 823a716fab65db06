// Start-up and the daemon-wide state: the listener, death-row, lock-state and
// main queues, the log, first-boot detection, the lock-state gate and the
// "cleanup complete" notifications.
//
// `start` does what the entry point does before it parks in the run loop:
// start-up (`quorvad_init`) is the first job of the listener queue, and the
// listener announces connections on that same queue, so no request is served
// before start-up has finished.
#pragma once

#include <atomic>
#include <memory>

#include "base/QRVMutex.h"
#include "base/QRVSerialQueue.h"
#include "core/QRVRelayDispatcher.h"
#include "core/QRVServices.h"
#include "operations/QRVClientConnection.h"
#include "upcall/QRVUpcallServer.h"

class QRVDaemon {
 public:
  // The name under which lock-state changes are observed.
  static constexpr const char* kLockStateNotification = "com.kelva.quorva.lockstate";

  struct Options {
    // Log level of the handle (5 = notice; 7 adds debug lines).
    int logLevel = 5;
  };

  QRVDaemon(std::shared_ptr<QRVServices> services, Options options);

  enum class StartResult {
    kServing,
    // The listener could not be created; the daemon runs without serving.
    kNotListening,
    // Another daemon holds the root: nothing was started, nothing touched.
    kRootInUse,
  };

  // Claims the root, then schedules start-up and opens the listener. The
  // claim comes first so that a second daemon on a root neither creates
  // anything nor takes connections (not even on a socket handed over by
  // systemd) from the one already serving it.
  StartResult start();

  // The steps of start-up and the callbacks it installs.
  void quorvad_init();
  void lockStateCallback();
  void set_first_boot_work_completed();
  void cleanupComplete();

  const std::shared_ptr<QRVSerialQueue>& listenerQueue() const { return listenerQueue_; }
  const std::shared_ptr<QRVSerialQueue>& lockStateQueue() const { return services_->lockStateQueue; }
  const std::shared_ptr<QRVSerialQueue>& deathRowQueue() const { return services_->deathRowQueue; }
  const std::shared_ptr<QRVClientConnection>& sharedClientConnection() const { return sharedConnection_; }
  QRVRelayDispatcher& dispatcher() { return dispatcher_; }
  bool isFirstBoot() const { return firstBoot_; }

 private:
  const std::shared_ptr<QRVServices> services_;
  const Options options_;
  QRVRelayDispatcher dispatcher_;
  QRVUpcallServer upcallServer_;

  std::shared_ptr<QRVSerialQueue> listenerQueue_;
  std::shared_ptr<QRVSerialQueue> mainQueue_;
  std::shared_ptr<QRVClientConnection> sharedConnection_;
  bool firstBoot_ = false;

  QRVMutex lockStateMutex_;
  int lockStateFlag_ GUARDED_BY(lockStateMutex_) = 0;  // 1 = lock-state queue suspended by us
};

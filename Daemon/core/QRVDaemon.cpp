#include "core/QRVDaemon.h"

#include <cstring>

#include "base/QRVLog.h"
#include "base/QRVResultCode.h"
#include "codesigning/QRVSQLiteDB.h"
#include "core/QRVExceptionReporter.h"
#include "platform/QRVNotificationService.h"

QRVDaemon::QRVDaemon(std::shared_ptr<QRVServices> services, Options options)
    : services_(std::move(services)), options_(options), dispatcher_(services_), upcallServer_(services_) {
  listenerQueue_ = QRVSerialQueue::create("com.kelva.quorvad.listener");
  mainQueue_ = QRVSerialQueue::create("com.kelva.quorvad.main");
  // Every entitled caller's entitlements are offered to the mapping, which
  // keeps them for identifiers that no installed code signature describes.
  // A caller without a signing identifier has nothing to register under.
  std::weak_ptr<QRVCodeSigningMapping> mapping = services_->codeSigningMapping;
  dispatcher_.setRegisteredEntitlementsProcessor(
      [mapping](const QRVPlist& entitlements, const std::string& identifier, QRVCommandQueue& queue) -> uint64_t {
        std::shared_ptr<QRVCodeSigningMapping> m = mapping.lock();
        if (!m || identifier.empty()) return QRVResultCode::kSuccess;
        return m->processCallerRegisteredEntitlements(entitlements, identifier, queue);
      },
      [] { return QRVSQLiteDB::changeCount(); });
}

QRVDaemon::StartResult QRVDaemon::start() {
  QRVError claimError;
  if (!services_->platform.instanceLock->acquire(&claimError)) {
    QRVLogError("quorvad cannot start: {}", claimError.message());
    return StartResult::kRootInUse;
  }

  QRVMessageService& messages = *services_->platform.messages;
  // Closed by the last step of start-up: the daemon is not idle while it
  // starts.
  messages.beginTransaction();
  listenerQueue_->async([this] { quorvad_init(); });

  QRVError error;
  bool listening = messages.listen(
      "com.kelva.quorvad", listenerQueue_,
      [this](const std::shared_ptr<QRVConnection>& connection) {
        auto peer = std::make_shared<QRVRelayPeer>();
        connection->setEventHandler(
            [this, peer](const std::shared_ptr<QRVConnection>& c, const QRVConnectionEvent& e) {
              dispatcher_.QRVProcessRelayEvent(c, e, peer.get());
            });
        connection->resume();
      },
      &error);
  if (!listening) QRVLogError("unable to start relay service!");
  return listening ? StartResult::kServing : StartResult::kNotListening;
}

void QRVDaemon::quorvad_init() {
  QRVGlobalConfiguration& config = *services_->globalConfiguration;
  std::string logPath = config.logDirectory() + "/quorvad.log";
  QRVLog::open("com.kelva.quorvad", logPath, options_.logLevel, config.logRotationCount(), config.logSizeLimit());
  QRVLogDebug("quorvad built at {} {} started", __DATE__, __TIME__);

  // The death-row and lock-state queues belong to the services, which every
  // connection reaches; they exist from the services' creation.
  if (!services_->deathRowQueue || !services_->lockStateQueue) QRVTerminate("Can't create dispatch queues.");

  // Without the subscription a persona added while the daemon runs would be
  // unknown until a restart; subscribing before set-up means no change made
  // during start-up is missed either.
  services_->userIdentityCache->registerForPersonaListUpdates();

  sharedConnection_ = QRVClientConnection::makeSharedClientConnection(services_);

  QRVFirstBootMarker& marker = *services_->platform.firstBootMarker;
  firstBoot_ = !marker.exists();
  if (firstBoot_) {
    QRVLogNotice("quorvad performing first boot initialization");
    sharedConnection_->rebootQuorvaSetup();
  }
  // A change the set-up restarts may find the device locked and queue its
  // retry at once: the lock-state queue must already be held by then, or the
  // retry would run (and fail, and queue itself again) until the
  // subscription below catches up.
  lockStateCallback();
  sharedConnection_->quorvaSetup();

  if (!upcallServer_.QRVKernServerStart(listenerQueue_)) QRVTerminate("Failed to initialize kernel upcall interface.");

  int status = services_->platform.lockState->observe([this] { mainQueue_->async([this] { lockStateCallback(); }); });
  if (status != 0)
    QRVLogError("notify_register_dispatch for notification \"{}\" failed; returned {}\n", kLockStateNotification,
                status);
  lockStateCallback();

  if (firstBoot_) sharedConnection_->rebootQuorvaCleanupWithCompletion([this] { set_first_boot_work_completed(); });
  sharedConnection_->quorvaCleanupWithCompletion([this] { cleanupComplete(); });

  services_->platform.messages->endTransaction();
}

void QRVDaemon::lockStateCallback() {
  int state = services_->platform.lockState->currentLockState();
  QRVLogDebug("LockState={}", state);
  QRVMutexLock lock(&lockStateMutex_);
  if (state == 1 && lockStateFlag_ != 1) {
    services_->lockStateQueue->suspend();
    lockStateFlag_ = 1;
  } else if (state == 0 && lockStateFlag_ == 1) {
    services_->lockStateQueue->resume();
    lockStateFlag_ = 0;
  }
}

void QRVDaemon::set_first_boot_work_completed() {
  QRVLogNotice("quorvad first boot cleanup complete");
  QRVFirstBootMarker& marker = *services_->platform.firstBootMarker;
  int errnum = 0;
  if (!marker.create(&errnum)) QRVLogError("Failed to create semaphore {}: {}", marker.name(), strerror(errnum));
  uint32_t status = services_->platform.notifications->post(kRebootCleanupCompleteNotification);
  if (status != 0) QRVLogError("Failed to post reboot-cleanup-complete: {}", status);
}

void QRVDaemon::cleanupComplete() {
  uint32_t status = services_->platform.notifications->post(kCleanupCompleteNotification);
  if (status != 0) QRVLogError("Failed to post cleanup-complete: {}", status);
}

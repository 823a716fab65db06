#include "core/QRVCommandHandlers.h"

#include "base/QRVLog.h"
#include "operations/QRVClientConnection.h"

// The function names below are what the log lines name.
namespace {

void retryTest(const QRVPlist& request, QRVClientConnection& connection, uint64_t* result) {
  if (!connection.services().globalConfiguration->isInternalImage()) {
    // Deliberately a success: the caller learns nothing about the build.
    QRVLogError("People really shouldn't be calling this on non-internal installs!");
    return;
  }
  QRVError error;
  if (!connection.retryTestWithNumCrashes(request.uint64ForKey("NumRetryCrashes"), &error))
    *result = error.resultCode();
}

void setTestLock(const QRVPlist& request, QRVClientConnection& connection, uint64_t* result) {
  if (!connection.services().globalConfiguration->isInternalImage()) {
    // Deliberately a success, as for the retry test.
    QRVLogError("Unsupported call to set lock!");
    return;
  }
  QRVError error;
  if (!connection.services().testLocks->setLockFromCommand(request.uint64ForKey("TestLock"),
                                                           request.boolForKey("Enable"), &error))
    *result = error.resultCode();
}

}  // namespace

void QRVHandleRetryTest(const QRVPlist& request, const std::shared_ptr<QRVReply>&, QRVClientConnection& connection,
                        uint64_t* result) {
  retryTest(request, connection, result);
}

void QRVHandleSetTestLock(const QRVPlist& request, const std::shared_ptr<QRVReply>&, QRVClientConnection& connection,
                          uint64_t* result) {
  setTestLock(request, connection, result);
}

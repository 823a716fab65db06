// The last resort for an exception nobody handled: record what happened as
// the process's crash message and abort, so the crash report says why.
#pragma once

#include <exception>
#include <string>

#include "base/QRVError.h"

// Never returns.
[[noreturn]] void QRVReportUncaughtException(std::exception_ptr exception);

// The text the reporter records, exposed for tests:
// "** INTERNAL ERROR: Uncaught Exception **\nException: <thread> name: reason\nStack:\n..."
std::string QRVUncaughtExceptionText(std::exception_ptr exception, const char* threadName);

// "name: reason" of an exception, for log lines and error messages.
std::string QRVExceptionDescription(std::exception_ptr exception);

// The message recorded by the last report (in a core dump: the symbol
// gQRVCrashMessage).
extern "C" const char* gQRVCrashMessage;

// Ends the process for a condition the daemon cannot run with, after saying
// why in the log and the system log.
[[noreturn]] void QRVTerminate(const std::string& message);

// Runs `body` and returns what it returns. An exception inside it is a bug
// of the daemon: on an internal image it goes to the crash report (which
// does not return), otherwise it becomes 40 through `error` and `failed` is
// returned, so that one request fails and the daemon goes on.
template <typename Result, typename Body>
Result QRVGuarded(bool internalImage, QRVError* error, Result failed, Body body) {
  try {
    return body();
  } catch (...) {
    if (internalImage) QRVReportUncaughtException(std::current_exception());
    QRVFail(error, QRV_ERROR(QRVResultCode::kException, "Got exception: {} : {}",
                             QRVExceptionDescription(std::current_exception()), "(no call stack)"));
    return failed;
  }
}

// The last resort for an exception nobody handled: record what happened as
// the process's crash message and abort, so the crash report says why.
#pragma once

#include <exception>
#include <string>

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

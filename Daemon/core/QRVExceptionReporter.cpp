#include "core/QRVExceptionReporter.h"

#include <cxxabi.h>
#include <execinfo.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <mutex>
#include <typeinfo>

#include "base/QRVLog.h"
#include "base/QRVSerialQueue.h"

const char* gQRVCrashMessage = nullptr;

namespace {

std::string demangle(const char* name) {
  int status = 0;
  char* d = abi::__cxa_demangle(name, nullptr, nullptr, &status);
  std::string out = (status == 0 && d) ? d : name;
  free(d);
  return out;
}

}  // namespace

namespace {

void describe(std::exception_ptr exception, std::string* name, std::string* reason) {
  try {
    std::rethrow_exception(exception);
  } catch (const std::exception& e) {
    *name = demangle(typeid(e).name());
    *reason = e.what();
  } catch (...) {
    if (std::type_info* t = abi::__cxa_current_exception_type()) *name = demangle(t->name());
  }
}

}  // namespace

std::string QRVExceptionDescription(std::exception_ptr exception) {
  std::string name, reason;
  describe(exception, &name, &reason);
  return name.empty() ? reason : name + ": " + reason;
}

std::string QRVUncaughtExceptionText(std::exception_ptr exception, const char* threadName) {
  std::string name, reason;
  describe(exception, &name, &reason);
  std::string text = "** INTERNAL ERROR: Uncaught Exception **\nException: ";
  if (threadName && *threadName) text += std::string("<") + threadName + "> ";
  if (!name.empty()) text += name + ": ";
  text += reason;
  text += "\nStack:\n";
  // The throw site's frames are gone; the reporter's own stack is the best
  // available record of where the exception ended.
  void* frames[64];
  int n = backtrace(frames, 64);
  if (char** symbols = backtrace_symbols(frames, n)) {
    for (int i = 0; i < n; i++) {
      if (i) text += "\n";
      text += symbols[i];
    }
    free(symbols);
  }
  return text;
}

void QRVReportUncaughtException(std::exception_ptr exception) {
  static std::mutex crashMessageLock;
  std::string text = QRVUncaughtExceptionText(exception, QRVSerialQueue::currentLabel());
  // Taken and never released: a second reporter on another thread waits here
  // until the abort below ends the process.
  crashMessageLock.lock();
  gQRVCrashMessage = strdup(text.c_str());
  QRVLogError("{}", text);
  QRVLog::writeSystem(QRVLogLevel::kError, text);
  abort();
}

void QRVTerminate(const std::string& message) {
  QRVLogError("{}", message);
  if (QRVLog::hasHandle()) QRVLog::writeSystem(QRVLogLevel::kError, message);
  gQRVCrashMessage = strdup(message.c_str());
  abort();
}

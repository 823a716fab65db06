// The one error type of the daemon.
//
// An error carries a domain, a numeric code, a rendered message, the function
// and source line that reported it, and optionally the error that caused it.
// Only the numeric code ever reaches a client; the rest is for the log.
//
// Errors are made through the QRV_ERROR family of macros, which fill in the
// reporting function and line and write the message to the log, so that every
// failure is logged exactly once, where it is first understood.
#pragma once

#include <fmt/format.h>

#include <cstdint>
#include <memory>
#include <string>
#include <utility>

#include "base/QRVLog.h"
#include "base/QRVResultCode.h"

class QRVError {
 public:
  static constexpr const char* kDomain = "QRVErrorDomain";
  static constexpr const char* kPOSIXDomain = "POSIXErrorDomain";
  // Failures of general facilities (a file that is not the expected format).
  static constexpr const char* kGeneralDomain = "GeneralErrorDomain";

  QRVError() = default;

  // The single builder. Prefer the macros below, which fill `function` and
  // `line`. `level` is the log level the error is reported at; a negative
  // level reports nothing (for codes that are an expected outcome, such as
  // "no such container").
  static QRVError make(const char* domain, uint64_t code, const char* function, uint32_t line,
                       int level, std::string message,
                       std::shared_ptr<const QRVError> underlying = nullptr);

  const std::string& domain() const { return domain_; }
  uint64_t code() const { return code_; }
  const std::string& message() const { return message_; }
  const std::string& functionName() const { return function_; }
  uint32_t sourceFileLine() const { return line_; }
  const QRVError* underlying() const { return underlying_.get(); }

  bool isPOSIX() const { return domain_ == kPOSIXDomain; }

  // The code to answer a client with for this failure. Only the daemon's
  // own codes are result codes. An error that was never filled in (code 0),
  // or one of another domain that reached the reply unwrapped (an errno: 1,
  // EPERM, would read as success, 28, ENOSPC, as "not deleted"), is a bug of
  // the daemon: it is logged and answered as QRVResultCode::kException, the
  // code for a failure inside an operation.
  uint64_t resultCode() const;

  // "<domain> <code>: <message> (function:line)", followed by the underlying
  // error's description.
  std::string description() const;

 private:
  std::string domain_;
  uint64_t code_ = 0;
  std::string message_;
  std::string function_;
  uint32_t line_ = 0;
  std::shared_ptr<const QRVError> underlying_;
};

// Stores `e` through `out` when the caller asked for it; returns false so that
// failing paths read `return QRVFail(error, QRV_ERROR(...));`.
inline bool QRVFail(QRVError* out, QRVError e) {
  if (out) *out = std::move(e);
  return false;
}

#define QRV_ERROR(code, ...)                                                            \
  QRVError::make(QRVError::kDomain, (code), __func__, __LINE__, QRVLogLevel::kError, \
                 fmt::format(__VA_ARGS__))
// An error that is an expected outcome: traced at debug level, not logged
// as an error.
#define QRV_ERROR_DEBUG(code, ...) \
  QRVError::make(QRVError::kDomain, (code), __func__, __LINE__, QRVLogLevel::kDebug, fmt::format(__VA_ARGS__))
// An error that is an expected outcome and therefore not logged.
#define QRV_ERROR_QUIET(code, ...) \
  QRVError::make(QRVError::kDomain, (code), __func__, __LINE__, -1, fmt::format(__VA_ARGS__))
#define QRV_ERROR_UNDERLYING(code, underlying, ...)                                     \
  QRVError::make(QRVError::kDomain, (code), __func__, __LINE__, QRVLogLevel::kError, \
                 fmt::format(__VA_ARGS__), std::make_shared<const QRVError>(underlying))
// errno is translated here, where the system call was made.
#define QRV_POSIX_ERROR(errnum, ...)                                                        \
  QRVError::make(QRVError::kPOSIXDomain, static_cast<uint64_t>(errnum), __func__, __LINE__, \
                 QRVLogLevel::kError, fmt::format(__VA_ARGS__))
#define QRV_POSIX_ERROR_QUIET(errnum, ...)                                                  \
  QRVError::make(QRVError::kPOSIXDomain, static_cast<uint64_t>(errnum), __func__, __LINE__, -1, \
                 fmt::format(__VA_ARGS__))

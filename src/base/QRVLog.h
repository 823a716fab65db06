// The process-wide log writer.
//
// There is one handle for the whole process. Levels follow syslog: 3 error,
// 5 notice, 6 informational, 7 debug. Errors and notices are written when
// there is no handle (then to the system log: the journal when running under
// systemd, stderr otherwise) or when the handle's level admits them;
// informational and debug lines only when a handle exists whose level admits
// them. Every line names the function that wrote it.
//
// Thread-safe: any thread may write; open/close are meant for start-up and
// tests.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include <fmt/format.h>

namespace QRVLogLevel {
constexpr int kError = 3;
constexpr int kNotice = 5;
constexpr int kInfo = 6;
constexpr int kDebug = 7;
}  // namespace QRVLogLevel

class QRVLog {
 public:
  // Opens the handle on `path` with a rotating file: `rotationCount` older
  // files of at most `sizeLimit` bytes are kept. On failure writes "Failed to
  // set up rotating logs at path <path>" to the system log, leaves the process
  // without a handle and returns false.
  static bool open(const std::string& subsystem, const std::string& path, int level,
                   size_t rotationCount, size_t sizeLimit);
  // Drops the handle (tests). Lines written afterwards go to the system log.
  static void close();

  static bool hasHandle();
  static void setLevel(int level);
  static bool isEnabled(int level);

  static void write(int level, std::string_view function, std::string_view message);
  // Writes to the system log regardless of the handle.
  static void writeSystem(int level, std::string_view message);
};

#define QRV_LOG_AT(level, ...)                                    \
  do {                                                            \
    if (QRVLog::isEnabled(level))                                 \
      QRVLog::write((level), __func__, fmt::format(__VA_ARGS__)); \
  } while (0)

#define QRVLogError(...) QRV_LOG_AT(QRVLogLevel::kError, __VA_ARGS__)
#define QRVLogNotice(...) QRV_LOG_AT(QRVLogLevel::kNotice, __VA_ARGS__)
#define QRVLogInfo(...) QRV_LOG_AT(QRVLogLevel::kInfo, __VA_ARGS__)
#define QRVLogDebug(...) QRV_LOG_AT(QRVLogLevel::kDebug, __VA_ARGS__)

// Routes the daemon's log to "capture.log" in a directory for the life of the
// object, so that a test can read back what was logged.
#pragma once

#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>

#include "base/QRVLog.h"

struct QRVLogCapture {
  explicit QRVLogCapture(const std::filesystem::path& dir, int level = QRVLogLevel::kDebug)
      : path(dir / "capture.log") {
    QRVLog::open("com.kelva.quorvad.test", path.string(), level, 1, 1 << 22);
  }
  ~QRVLogCapture() { QRVLog::close(); }
  QRVLogCapture(const QRVLogCapture&) = delete;
  QRVLogCapture& operator=(const QRVLogCapture&) = delete;
  std::string text() const {
    std::ifstream in(path);
    return std::string(std::istreambuf_iterator<char>(in), {});
  }
  const std::filesystem::path path;
};

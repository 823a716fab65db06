// Calls back whenever a file is written, replaced or removed. Watches the
// file's directory (writers usually replace a file by renaming over it) on a
// thread of its own.
#pragma once

#include <functional>
#include <string>
#include <thread>

class QRVFileWatcher {
 public:
  QRVFileWatcher() = default;
  ~QRVFileWatcher();
  QRVFileWatcher(const QRVFileWatcher&) = delete;
  QRVFileWatcher& operator=(const QRVFileWatcher&) = delete;

  // Starts watching `path` (its directory is created if missing). Returns 0
  // or an errno value; a second call returns EBUSY.
  int start(const std::string& path, std::function<void()> onChange);

 private:
  int inotifyFd_ = -1;
  int stopFd_ = -1;
  std::thread thread_;
};

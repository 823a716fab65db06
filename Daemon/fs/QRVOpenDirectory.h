// A directory held open so that many files below it can be read relative to
// its descriptor: one path lookup per file instead of one from the root, and
// the directory itself cannot be swapped for another one in the meantime.
// Made by QRVFileManager::openDirectoryAtURL; the descriptor is closed when
// the object goes away.
//
// Thread-safe: the descriptor is only ever the base of *at(2) calls (its read
// position is never used), so any number of threads may read below it at
// once.
#pragma once

#include <memory>
#include <string>

#include "platform/QRVFileSystem.h"

class QRVOpenDirectory {
 public:
  QRVOpenDirectory(std::shared_ptr<QRVFileSystem> files, int fd, std::string url)
      : files_(std::move(files)), fd_(fd), url_(std::move(url)) {}
  ~QRVOpenDirectory();
  QRVOpenDirectory(const QRVOpenDirectory&) = delete;
  QRVOpenDirectory& operator=(const QRVOpenDirectory&) = delete;

  int fd() const { return fd_; }
  // The path it was opened by, for paths in errors and log lines.
  const std::string& url() const { return url_; }

 private:
  const std::shared_ptr<QRVFileSystem> files_;
  const int fd_;
  const std::string url_;
};

// The claim on a root as an exclusive flock on a file in the root's run
// directory. The kernel drops the lock with the last descriptor of the open
// file, so a daemon that dies (even by SIGKILL) never leaves a stale claim
// behind, and the file itself may stay.
#pragma once

#include <string>

#include "platform/QRVInstanceLock.h"

class QRVLinuxInstanceLock : public QRVInstanceLock {
 public:
  // `path` is the lock file; its directory is created when missing.
  explicit QRVLinuxInstanceLock(std::string path);
  ~QRVLinuxInstanceLock() override;
  QRVLinuxInstanceLock(const QRVLinuxInstanceLock&) = delete;
  QRVLinuxInstanceLock& operator=(const QRVLinuxInstanceLock&) = delete;

  const std::string& path() const override { return path_; }
  bool acquire(QRVError* error) override;

 private:
  const std::string path_;
  int fd_ = -1;
};

#include "platform/linux/QRVLinuxInstanceLock.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

QRVLinuxInstanceLock::QRVLinuxInstanceLock(std::string path) : path_(std::move(path)) {}

QRVLinuxInstanceLock::~QRVLinuxInstanceLock() {
  if (fd_ >= 0) ::close(fd_);
}

bool QRVLinuxInstanceLock::acquire(QRVError* error) {
  if (fd_ >= 0) return true;
  std::error_code ec;
  std::filesystem::create_directories(std::filesystem::path(path_).parent_path(), ec);
  // O_CLOEXEC: a child the daemon starts must not inherit (and so prolong)
  // the claim.
  int fd = ::open(path_.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600);
  if (fd < 0) {
    int e = errno;
    return QRVFail(error, QRV_POSIX_ERROR(e, "cannot open the lock file {}: {}", path_, strerror(e)));
  }
  int rc;
  do {
    rc = flock(fd, LOCK_EX | LOCK_NB);
  } while (rc != 0 && errno == EINTR);
  if (rc != 0) {
    int e = errno;
    ::close(fd);
    if (e == EWOULDBLOCK)
      return QRVFail(error, QRV_POSIX_ERROR_QUIET(e, "another quorvad already runs on this root (it holds {})", path_));
    return QRVFail(error, QRV_POSIX_ERROR(e, "cannot lock {}: {}", path_, strerror(e)));
  }
  // The holder's pid, for whoever wonders which process has the root. Only
  // informative: the lock, not the contents, is the claim.
  std::string pid = std::to_string(getpid()) + "\n";
  if (ftruncate(fd, 0) == 0) {
    ssize_t ignored = pwrite(fd, pid.data(), pid.size(), 0);
    (void)ignored;
  }
  fd_ = fd;
  return true;
}

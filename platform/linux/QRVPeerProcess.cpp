#include "platform/linux/QRVPeerProcess.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <string_view>

#include "platform/linux/QRVProcInfo.h"

QRVPeerProcess::QRVPeerProcess(pid_t pid, int pidfd) {
  if (pidfd < 0) return;
  std::string path = "/proc/" + std::to_string(pid);
  procFD_ = open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
  if (procFD_ >= 0) statusFD_ = openat(procFD_, "status", O_RDONLY | O_CLOEXEC);
  pollfd exited{pidfd, POLLIN, 0};
  if (procFD_ < 0 || statusFD_ < 0 || poll(&exited, 1, 0) != 0) {
    if (statusFD_ >= 0) close(statusFD_);
    if (procFD_ >= 0) close(procFD_);
    procFD_ = statusFD_ = -1;
  }
}

QRVPeerProcess::~QRVPeerProcess() {
  if (statusFD_ >= 0) close(statusFD_);
  if (procFD_ >= 0) close(procFD_);
}

std::optional<QRVPeerProcessState> QRVPeerProcess::state() {
  if (procFD_ < 0) return std::nullopt;
  // The link is followed to the file being run; it is gone once the
  // process has exited.
  struct stat exe;
  if (fstatat(procFD_, "exe", &exe, 0) != 0) return std::nullopt;
  if (!confined_) {
    // A proc file read from offset 0 is generated afresh. One that fills
    // the buffer (a process in thousands of groups) may have the lines that
    // matter cut off: then the state is not known.
    char buffer[8192];
    ssize_t n = pread(statusFD_, buffer, sizeof buffer, 0);
    if (n <= 0 || static_cast<size_t>(n) == sizeof buffer) return std::nullopt;
    confined_ = QRVProcInfo::statusShowsConfinement(std::string_view(buffer, static_cast<size_t>(n)));
  }
  return QRVPeerProcessState{static_cast<uint64_t>(exe.st_dev), static_cast<uint64_t>(exe.st_ino), confined_};
}

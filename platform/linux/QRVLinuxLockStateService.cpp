#include "platform/linux/QRVLinuxLockStateService.h"

#include <fcntl.h>
#include <unistd.h>

#include <cstdlib>

QRVLinuxLockStateService::QRVLinuxLockStateService(std::string path) : path_(std::move(path)) {}

int QRVLinuxLockStateService::readFile() const {
  int fd = open(path_.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return 0;
  char text[16];
  ssize_t n = read(fd, text, sizeof text - 1);
  close(fd);
  if (n <= 0) return 0;
  text[n] = '\0';
  char* end = nullptr;
  long state = strtol(text, &end, 10);
  return end == text ? 0 : static_cast<int>(state);
}

void QRVLinuxLockStateService::refresh() {
  QRVMutexLock lock(&refreshMutex_);
  known_.store(readFile(), std::memory_order_release);
}

int QRVLinuxLockStateService::currentLockState() {
  if (watching_.load(std::memory_order_acquire)) return known_.load(std::memory_order_acquire);
  return readFile();
}

int QRVLinuxLockStateService::observe(std::function<void()> onChange) {
  int status = watcher_.start(path_, [this, onChange = std::move(onChange)] {
    refresh();
    onChange();
  });
  if (status != 0) return status;
  // After the watch is in place: a write from here on is seen by the watch,
  // one before it by this read.
  refresh();
  watching_.store(true, std::memory_order_release);
  return 0;
}

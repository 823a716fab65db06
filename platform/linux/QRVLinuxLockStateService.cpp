#include "platform/linux/QRVLinuxLockStateService.h"

#include <fstream>

QRVLinuxLockStateService::QRVLinuxLockStateService(std::string path) : path_(std::move(path)) {}

int QRVLinuxLockStateService::currentLockState() {
  std::ifstream in(path_);
  int state = 0;
  if (!(in >> state)) return 0;
  return state;
}

int QRVLinuxLockStateService::observe(std::function<void()> onChange) {
  return watcher_.start(path_, std::move(onChange));
}

// Lock state from a file holding "0" or "1" (<root>/run/quorva/lockstate),
// watched with inotify. A missing or unreadable file reads as unlocked.
#pragma once

#include <atomic>
#include <string>
#include <thread>

#include "QRVLockStateService.h"

class QRVLinuxLockStateService : public QRVLockStateService {
 public:
  explicit QRVLinuxLockStateService(std::string path);
  ~QRVLinuxLockStateService() override;

  int currentLockState() override;
  int observe(std::function<void()> onChange) override;

 private:
  const std::string path_;
  int inotifyFd_ = -1;
  int stopFd_ = -1;
  std::thread watcher_;
};

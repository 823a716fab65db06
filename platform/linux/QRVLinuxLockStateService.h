// Lock state from a file holding "0" or "1" (<root>/run/quorva/lockstate),
// watched with inotify. A missing or unreadable file reads as unlocked.
#pragma once

#include <string>

#include "platform/QRVLockStateService.h"
#include "platform/linux/QRVFileWatcher.h"

class QRVLinuxLockStateService : public QRVLockStateService {
 public:
  explicit QRVLinuxLockStateService(std::string path);

  int currentLockState() override;
  int observe(std::function<void()> onChange) override;

 private:
  const std::string path_;
  QRVFileWatcher watcher_;
};

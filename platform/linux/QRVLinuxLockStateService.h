// Lock state from a file holding "0" or "1" (<root>/run/quorva/lockstate),
// watched with inotify. A missing or unreadable file, or one that does not
// start with a number, reads as unlocked.
//
// Every class change the file system makes asks for the state, so asking
// must cost no system call: once observed, the state is read from the file
// when the watch reports a change and kept in memory; the answer is then
// current as soon as the watch has seen the write (well under a millisecond,
// and always before observers are told). Unobserved, every question reads
// the file.
#pragma once

#include <atomic>
#include <string>

#include "base/QRVMutex.h"
#include "platform/QRVLockStateService.h"
#include "platform/linux/QRVFileWatcher.h"

class QRVLinuxLockStateService : public QRVLockStateService {
 public:
  explicit QRVLinuxLockStateService(std::string path);

  int currentLockState() override;
  int observe(std::function<void()> onChange) override;

 private:
  int readFile() const;
  // Reads the file into `known_`. Serialised, so that a later read is never
  // overwritten by an earlier one.
  void refresh();

  const std::string path_;
  QRVMutex refreshMutex_;
  std::atomic<int> known_{0};
  std::atomic<bool> watching_{false};
  // Last: its thread calls refresh, so it must stop before the rest goes.
  QRVFileWatcher watcher_;
};

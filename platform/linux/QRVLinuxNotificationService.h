// Notifications as files: posting NAME writes a line to the system log and
// touches <directory>/NAME, which other processes watch with inotify.
#pragma once

#include <string>

#include "platform/QRVNotificationService.h"

class QRVLinuxNotificationService : public QRVNotificationService {
 public:
  explicit QRVLinuxNotificationService(std::string directory) : directory_(std::move(directory)) {}
  uint32_t post(const std::string& name) override;

 private:
  const std::string directory_;
};

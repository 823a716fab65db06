// Named, content-free notifications posted for other processes.
#pragma once

#include <string>

// The names agreed with the clients.
constexpr const char* kCleanupCompleteNotification = "com.kelva.quorvad.cleanup-complete";
constexpr const char* kRebootCleanupCompleteNotification = "com.kelva.quorvad.reboot-cleanup-complete";

class QRVNotificationService {
 public:
  virtual ~QRVNotificationService() = default;
  // Returns 0 on success, otherwise an errno value.
  virtual uint32_t post(const std::string& name) = 0;
};

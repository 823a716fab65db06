// The device lock state: 0 unlocked, 1 locked, anything else transitional.
#pragma once

#include <functional>

class QRVLockStateService {
 public:
  virtual ~QRVLockStateService() = default;

  virtual int currentLockState() = 0;
  // Registers `onChange`, called after every change of the state (it reads
  // the state itself). Returns 0 on success, as the notification service's
  // registration does, or an errno value.
  virtual int observe(std::function<void()> onChange) = 0;
};

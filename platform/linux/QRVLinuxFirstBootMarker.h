// The first-boot marker as a named POSIX semaphore: it lives in /dev/shm,
// which is empty after every boot. Under a development root the name carries
// a suffix derived from the root so that roots never share a marker.
#pragma once

#include <string>

#include "platform/QRVFirstBootMarker.h"

class QRVLinuxFirstBootMarker : public QRVFirstBootMarker {
 public:
  // `root` is the daemon's root directory ("/" on a device).
  explicit QRVLinuxFirstBootMarker(const std::string& root);
  const std::string& name() const override { return name_; }
  bool exists() override;
  bool create(int* errnum) override;

 private:
  std::string name_;
};

// Switches read from the system configuration.
#pragma once

#include <string>

class QRVFeatureFlags {
 public:
  virtual ~QRVFeatureFlags() = default;
  virtual bool isEnabled(const std::string& domain, const std::string& feature) = 0;
};

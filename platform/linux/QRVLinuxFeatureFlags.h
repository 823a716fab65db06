// Feature flags from a property list: {"<domain>": {"<feature>": bool}}.
// Read on every question: flags are asked rarely and may change at any time.
#pragma once

#include <string>

#include "platform/QRVFeatureFlags.h"

class QRVLinuxFeatureFlags : public QRVFeatureFlags {
 public:
  explicit QRVLinuxFeatureFlags(std::string path) : path_(std::move(path)) {}
  bool isEnabled(const std::string& domain, const std::string& feature) override;

 private:
  const std::string path_;
};

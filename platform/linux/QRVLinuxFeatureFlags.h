// Feature flags from a property list: {"<domain>": {"<feature>": bool}}.
// Flags are asked on hot paths (every creation) and change rarely: the file
// is read once and read again only when its identity or times change, which
// one stat(2) per question tells. A missing or unreadable file means every
// flag is off.
#pragma once

#include <sys/stat.h>

#include <optional>
#include <string>

#include "base/QRVMutex.h"
#include "base/QRVPlist.h"
#include "platform/QRVFeatureFlags.h"

class QRVLinuxFeatureFlags : public QRVFeatureFlags {
 public:
  explicit QRVLinuxFeatureFlags(std::string path) : path_(std::move(path)) {}
  bool isEnabled(const std::string& domain, const std::string& feature) override;

 private:
  // What identifies one version of the file; all zero when there is none.
  struct Version {
    dev_t device = 0;
    ino_t inode = 0;
    off_t size = 0;
    struct timespec modified {};
    struct timespec changed {};
    bool operator==(const Version& other) const;
  };

  const std::string path_;
  QRVMutex mutex_;
  std::optional<Version> version_ GUARDED_BY(mutex_);
  std::optional<QRVPlist> flags_ GUARDED_BY(mutex_);
};

// Stopping applications through their cgroups. Every application instance
// runs in a scope unit "app-<identifier>.scope" under one slice; killing the
// scope's cgroup stops all of its processes at once, and freezing it keeps
// anything that is started in it from running until the assertion ends.
#pragma once

#include <string>

#include "platform/QRVApplicationTermination.h"

class QRVLinuxApplicationTermination : public QRVApplicationTermination {
 public:
  // `sliceDirectory`: the slice's directory in the cgroup file system, e.g.
  // "/sys/fs/cgroup/quorva-apps.slice".
  explicit QRVLinuxApplicationTermination(std::string sliceDirectory) : sliceDirectory_(std::move(sliceDirectory)) {}

  // An identifier with no cgroup has nothing running: the assertion is
  // granted and holds nothing. Fails with an errno when the cgroup exists
  // but cannot be frozen or killed, and with EINVAL for an identifier that
  // is not a single path component.
  std::unique_ptr<Assertion> terminate(const std::string& identifier, const std::string& reason,
                                       QRVError* error) override;

  std::string scopeDirectoryForIdentifier(const std::string& identifier) const;

 private:
  const std::string sliceDirectory_;
};

// The sandbox facility on Linux. A process counts as sandboxed when it runs
// with no_new_privs and a seccomp filter. Extension tokens and the launcher's
// path registry are not built yet: both calls fail with ENOTSUP.
#pragma once

#include "QRVSandbox.h"

class QRVLinuxSandbox : public QRVSandbox {
 public:
  bool isSandboxed(const QRVAuditToken& token) override;
  std::optional<std::string> issueExtension(const std::string& extensionClass, const std::string& path,
                                            const QRVAuditToken& token, int* errnum) override;
  bool registerContainerPath(const std::string& identifier, const std::string& path, uint32_t persona,
                             QRVError* error) override;
};

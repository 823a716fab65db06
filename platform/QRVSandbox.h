// The sandbox facility: whether a process is sandboxed, extension tokens that
// grant a sandboxed process access to a path, and the container paths that
// the sandbox launcher maps for a persona.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "QRVAuditToken.h"
#include "QRVError.h"

class QRVSandbox {
 public:
  virtual ~QRVSandbox() = default;

  virtual bool isSandboxed(const QRVAuditToken& token) = 0;
  // A token granting `token`'s process access of class `extensionClass` to
  // `path`; none on failure (errno stored through `errnum`).
  virtual std::optional<std::string> issueExtension(const std::string& extensionClass,
                                                    const std::string& path,
                                                    const QRVAuditToken& token, int* errnum) = 0;
  // Records the container path of `identifier` for `persona`.
  virtual bool registerContainerPath(const std::string& identifier, const std::string& path,
                                     uint32_t persona, QRVError* error) = 0;
};

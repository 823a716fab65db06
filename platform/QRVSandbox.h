// The sandbox facility: whether a process is sandboxed, extension tokens that
// grant a sandboxed process access to a path, and the container paths that
// the sandbox launcher maps for each user and persona (user-state items).
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "base/QRVError.h"
#include "platform/QRVAuditToken.h"

// One mapping the launcher uses to find a process's container: for the user
// `uid` in persona `personaID`, items of `itemType` named `identifier` live at
// `path`. An item without a path removes the mapping.
struct QRVSandboxUserStateItem {
  // Item types by container kind.
  static constexpr uint64_t kDataContainer = 1;
  static constexpr uint64_t kApplicationGroup = 2;
  static constexpr uint64_t kSystemData = 4;
  static constexpr uint64_t kSystemGroup = 8;

  uint32_t uid = 0;
  uint32_t personaID = 0;
  uint64_t itemType = 0;
  std::string identifier;
  std::optional<std::string> path;

  bool operator==(const QRVSandboxUserStateItem&) const = default;
};

class QRVSandbox {
 public:
  virtual ~QRVSandbox() = default;

  virtual bool isSandboxed(const QRVAuditToken& token) = 0;
  // A token granting `token`'s process access of class `extensionClass` to
  // `path`; none on failure (errno stored through `errnum`).
  virtual std::optional<std::string> issueExtension(const std::string& extensionClass,
                                                    const std::string& path,
                                                    const QRVAuditToken& token, int* errnum) = 0;
  // Sets (path given) or removes (no path) one mapping. Returns 0 on success,
  // otherwise an errno value. Fast: publishing the mappings to the launcher
  // happens later, off the caller's thread.
  virtual int setUserStateItem(const QRVSandboxUserStateItem& item) = 0;
};

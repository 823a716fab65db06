#include "linux/QRVLinuxSandbox.h"

#include <cerrno>

#include "linux/QRVProcInfo.h"

bool QRVLinuxSandbox::isSandboxed(const QRVAuditToken& token) {
  // Only the process the token names: a recycled pid is not our peer.
  std::optional<uint64_t> start = QRVProcInfo::startTime(token.pid());
  return start && *start == token.startTime() && QRVProcInfo::isSandboxed(token.pid());
}

std::optional<std::string> QRVLinuxSandbox::issueExtension(const std::string&, const std::string&,
                                                           const QRVAuditToken&, int* errnum) {
  if (errnum) *errnum = ENOTSUP;
  return std::nullopt;
}

bool QRVLinuxSandbox::registerContainerPath(const std::string& identifier, const std::string&, uint32_t,
                                            QRVError* error) {
  return QRVFail(error, QRV_POSIX_ERROR_QUIET(ENOTSUP, "container path registry not available for {}",
                                              identifier));
}

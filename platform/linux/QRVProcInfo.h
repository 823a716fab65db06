// Facts about a live process read from /proc. Every function answers for the
// process as it is at the time of the call; callers that need them to belong
// to a particular process compare its start time (see QRVAuditToken).
#pragma once

#include <sys/socket.h>
#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/QRVAuditToken.h"

namespace QRVProcInfo {

// Field 22 of /proc/<pid>/stat: clock ticks after boot at which it started.
std::optional<uint64_t> startTime(pid_t pid);

// The audit token of a socket peer with credentials `cred`. `pidfd` (-1 when
// there is none) pins the process: when it has already exited by the time its
// start time has been read, the pid may be someone else's by now, so the
// token gets no start time and matches no trust-store entry.
QRVAuditToken auditTokenForPeer(const ucred& cred, int pidfd);

// Device and inode of the process's executable (/proc/<pid>/exe).
struct FileId {
  dev_t device = 0;
  ino_t inode = 0;
  bool operator==(const FileId&) const = default;
};
std::optional<FileId> executable(pid_t pid);
// The path of the process's executable (the target of /proc/<pid>/exe),
// only while that path still names the very file being run: none for an
// executable that was deleted, or replaced by another file at the same path.
std::optional<std::string> executablePath(pid_t pid);

// Runs with no_new_privs and a seccomp filter: how a sandboxed process shows.
bool isSandboxed(pid_t pid);
// The same, read from the text of /proc/<pid>/status.
bool statusShowsConfinement(std::string_view status);

// The numeric id of a "persona-<id>.slice" component of the process's cgroup
// path, if any.
std::optional<uint32_t> personaFromCgroup(pid_t pid);

}  // namespace QRVProcInfo

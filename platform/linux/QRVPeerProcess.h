// Descriptors kept for a connected peer process, so that what it can change
// about itself after connecting (see QRVPeerProcessState) is re-read with
// one or two system calls per request instead of path look-ups in /proc.
//
// The descriptors name the process itself, not its pid: once it has exited
// and been reaped they fail (ESRCH) even if the pid is given to another
// process, so a state is never read from a stranger.
#pragma once

#include <sys/types.h>

#include <optional>

#include "platform/QRVMessageService.h"

class QRVPeerProcess {
 public:
  // Opens /proc/<pid> and its status file. `pidfd` (-1: none) pins the
  // process: when it has exited by the time the descriptors are open, they
  // may belong to a later owner of the pid, and the handle stays empty. An
  // empty handle answers no state, so its callers fall back to reading the
  // process from scratch.
  QRVPeerProcess(pid_t pid, int pidfd);
  ~QRVPeerProcess();
  QRVPeerProcess(const QRVPeerProcess&) = delete;
  QRVPeerProcess& operator=(const QRVPeerProcess&) = delete;

  // The executable's identity and the confinement, or none when the process
  // has exited (a zombie has no executable) or the handle is empty. One
  // thread at a time.
  std::optional<QRVPeerProcessState> state();

 private:
  int procFD_ = -1;
  int statusFD_ = -1;
  // Confinement cannot be undone: once seen, the status file need not be
  // read again.
  bool confined_ = false;
};

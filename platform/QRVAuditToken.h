// The identity of a peer process as the daemon records it: 32 bytes holding
// the effective uid and gid, the pid and the process's start time (clock ticks
// since boot). The start time makes a token unique across pid reuse: a
// restarted process never repeats a token.
//
// Layout (native endianness, as eight 32-bit words):
//   0 uid, 1 gid, 2 pid, 3 reserved (0), 4-5 start time (low, high), 6-7 0
#pragma once

#include <sys/types.h>

#include <array>
#include <cstdint>
#include <cstring>

struct QRVAuditToken {
  std::array<uint32_t, 8> words{};

  static QRVAuditToken make(uid_t uid, gid_t gid, pid_t pid, uint64_t startTime) {
    QRVAuditToken t;
    t.words[0] = uid;
    t.words[1] = gid;
    t.words[2] = static_cast<uint32_t>(pid);
    t.words[4] = static_cast<uint32_t>(startTime);
    t.words[5] = static_cast<uint32_t>(startTime >> 32);
    return t;
  }

  uid_t uid() const { return words[0]; }
  gid_t gid() const { return words[1]; }
  pid_t pid() const { return static_cast<pid_t>(words[2]); }
  uint64_t startTime() const { return words[4] | (static_cast<uint64_t>(words[5]) << 32); }
  bool isZero() const { return words == std::array<uint32_t, 8>{}; }

  bool operator==(const QRVAuditToken&) const = default;
};
static_assert(sizeof(QRVAuditToken) == 32);

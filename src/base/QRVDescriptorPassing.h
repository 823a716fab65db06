// Messages that carry descriptors over Unix-domain sockets, and the sealed
// memory files that carry bytes nobody can change once sent. Shared by the
// upcall transport and its clients.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <vector>

namespace QRVDescriptorPassing {

// The seals that make a memory file's bytes final: no writes, no growing,
// no shrinking.
constexpr int kContentSeals = 0x0008 | 0x0004 | 0x0002;  // F_SEAL_WRITE | F_SEAL_GROW | F_SEAL_SHRINK

// A close-on-exec memory file named `name` holding `bytes`, sealed with
// kContentSeals and against further seals; -1 (errno set) on failure.
int makeSealedMemory(const char* name, const std::vector<uint8_t>& bytes);

// Sends `message` on `socket` with `fd` attached (none when -1). Returns
// sendmsg's result; SIGPIPE is never raised.
ssize_t send(int socket, const std::vector<uint8_t>& message, int fd, int flags);

// Receives one message into `buffer` (close-on-exec for the descriptors that
// come with it, which are appended to `fds` and belong to the caller).
// `truncatedDescriptors` is set when more came than there was room for (the
// kernel closed those). Returns recvmsg's result.
ssize_t receive(int socket, uint8_t* buffer, size_t size, int flags, std::vector<int>* fds,
                bool* truncatedDescriptors);

}  // namespace QRVDescriptorPassing

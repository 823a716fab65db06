#include "base/QRVDescriptorPassing.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace QRVDescriptorPassing {

static_assert(kContentSeals == (F_SEAL_WRITE | F_SEAL_GROW | F_SEAL_SHRINK));

namespace {
// Room for a few descriptors: more than one is an error the receiver must
// see (and close) rather than have the kernel drop them unseen.
constexpr size_t kMaxDescriptors = 8;
}  // namespace

int makeSealedMemory(const char* name, const std::vector<uint8_t>& bytes) {
  int fd = memfd_create(name, MFD_CLOEXEC | MFD_ALLOW_SEALING);
  if (fd < 0) return -1;
  size_t done = 0;
  while (done < bytes.size()) {
    ssize_t n = write(fd, bytes.data() + done, bytes.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    done += static_cast<size_t>(n);
  }
  if (done != bytes.size() || fcntl(fd, F_ADD_SEALS, kContentSeals | F_SEAL_SEAL) != 0) {
    int e = done != bytes.size() && errno == 0 ? ENOSPC : errno;
    close(fd);
    errno = e;
    return -1;
  }
  return fd;
}

ssize_t send(int socket, const std::vector<uint8_t>& message, int fd, int flags) {
  iovec iov{const_cast<uint8_t*>(message.data()), message.size()};
  msghdr msg{};
  msg.msg_iov = &iov;
  msg.msg_iovlen = 1;
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
  if (fd >= 0) {
    msg.msg_control = control;
    msg.msg_controllen = sizeof control;
    cmsghdr* c = CMSG_FIRSTHDR(&msg);
    c->cmsg_level = SOL_SOCKET;
    c->cmsg_type = SCM_RIGHTS;
    c->cmsg_len = CMSG_LEN(sizeof(int));
    memcpy(CMSG_DATA(c), &fd, sizeof fd);
  }
  ssize_t n;
  while ((n = sendmsg(socket, &msg, flags | MSG_NOSIGNAL)) < 0 && errno == EINTR) {
  }
  return n;
}

ssize_t receive(int socket, uint8_t* buffer, size_t size, int flags, std::vector<int>* fds,
                bool* truncatedDescriptors) {
  iovec iov{buffer, size};
  alignas(cmsghdr) char control[CMSG_SPACE(kMaxDescriptors * sizeof(int))];
  msghdr msg{};
  msg.msg_iov = &iov;
  msg.msg_iovlen = 1;
  msg.msg_control = control;
  msg.msg_controllen = sizeof control;
  ssize_t n;
  while ((n = recvmsg(socket, &msg, flags | MSG_CMSG_CLOEXEC)) < 0 && errno == EINTR) {
  }
  if (truncatedDescriptors) *truncatedDescriptors = n >= 0 && (msg.msg_flags & MSG_CTRUNC);
  for (cmsghdr* c = CMSG_FIRSTHDR(&msg); n >= 0 && c; c = CMSG_NXTHDR(&msg, c)) {
    if (c->cmsg_level != SOL_SOCKET || c->cmsg_type != SCM_RIGHTS) continue;
    size_t count = (c->cmsg_len - CMSG_LEN(0)) / sizeof(int);
    for (size_t i = 0; i < count; i++) {
      int fd;
      memcpy(&fd, CMSG_DATA(c) + i * sizeof(int), sizeof fd);
      fds->push_back(fd);
    }
  }
  return n;
}

}  // namespace QRVDescriptorPassing

#include "platform/linux/QRVUnixSocket.h"

#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "base/QRVLog.h"

namespace QRVUnixSocket {

bool prepareToBind(const std::string& path, sockaddr_un* address, QRVError* error) {
  *address = sockaddr_un{};
  if (path.size() >= sizeof address->sun_path)
    return QRVFail(error, QRV_POSIX_ERROR(ENAMETOOLONG, "socket path too long: {}", path));
  address->sun_family = AF_UNIX;
  memcpy(address->sun_path, path.c_str(), path.size() + 1);
  std::error_code ec;
  std::filesystem::create_directories(std::filesystem::path(path).parent_path(), ec);
  struct stat st;
  if (lstat(path.c_str(), &st) == 0 && S_ISSOCK(st.st_mode)) unlink(path.c_str());
  return true;
}

int next(int listenFd, const char* service) {
  for (;;) {
    int fd = accept4(listenFd, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
    if (fd >= 0) return fd;
    // A peer that gave up while waiting, or a signal: the next one may be there.
    if (errno == EINTR || errno == ECONNABORTED) continue;
    if (errno != EAGAIN && errno != EWOULDBLOCK) {
      QRVLogError("{}: accept failed: {}", service, strerror(errno));
      if (errno == EMFILE || errno == ENFILE) usleep(10'000);
    }
    return -1;
  }
}

}  // namespace QRVUnixSocket

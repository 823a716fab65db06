#include "platform/linux/QRVDirectoryReader.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace {

bool isDotOrDotDot(const char* name) {
  return name[0] == '.' && (name[1] == '\0' || (name[1] == '.' && name[2] == '\0'));
}

}  // namespace

int QRVForEachDirectoryEntry(int fd, const std::function<int(const dirent& entry)>& visit) {
  // "." of the directory is never a link, so this opens exactly `fd`'s
  // directory, with a read position of its own (dup would share it).
  int own = ::openat(fd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (own < 0) return errno;
  DIR* dir = ::fdopendir(own);
  if (!dir) {
    int e = errno;
    ::close(own);
    return e;
  }
  int result = 0;
  for (;;) {
    errno = 0;
    const dirent* entry = ::readdir(dir);
    if (!entry) {
      result = errno;
      break;
    }
    if (isDotOrDotDot(entry->d_name)) continue;
    if ((result = visit(*entry)) != 0) break;
  }
  ::closedir(dir);
  return result;
}

int QRVReadDirectoryNames(int fd, std::vector<char>* buffer, std::string* names) {
  for (;;) {
    ssize_t n = ::getdents64(fd, buffer->data(), buffer->size());
    if (n < 0) return errno;
    if (n == 0) return 0;
    for (ssize_t at = 0; at < n;) {
      const auto* entry = reinterpret_cast<const dirent64*>(buffer->data() + at);
      at += entry->d_reclen;
      if (isDotOrDotDot(entry->d_name)) continue;
      names->append(entry->d_name, std::strlen(entry->d_name) + 1);
    }
  }
}

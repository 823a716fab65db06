#include "platform/linux/QRVDirectoryReader.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

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
    const char* name = entry->d_name;
    if (name[0] == '.' && (name[1] == '\0' || (name[1] == '.' && name[2] == '\0'))) continue;
    if ((result = visit(*entry)) != 0) break;
  }
  ::closedir(dir);
  return result;
}

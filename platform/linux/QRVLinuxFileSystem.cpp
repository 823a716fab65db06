#include "platform/linux/QRVLinuxFileSystem.h"

#include <dirent.h>
#include <fcntl.h>
#include <limits.h>
#include <linux/openat2.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>

#include "platform/linux/QRVDirectoryReader.h"

namespace {

int result(int r) { return r == 0 ? 0 : errno; }

}  // namespace

int QRVLinuxFileSystem::open(int directoryFD, const std::string& path, int flags, mode_t mode, int* fd) {
  int opened;
  do {
    opened = ::openat(directoryFD, path.c_str(), flags, mode);
  } while (opened < 0 && errno == EINTR);
  if (opened < 0) return errno;
  *fd = opened;
  return 0;
}

int QRVLinuxFileSystem::openResolved(int directoryFD, const std::string& path, int flags, uint64_t resolve, int* fd) {
#ifdef SYS_openat2
  struct open_how how = {};
  how.flags = static_cast<uint64_t>(flags);
  how.resolve = resolve;
  long opened;
  do {
    opened = ::syscall(SYS_openat2, directoryFD, path.c_str(), &how, sizeof how);
  } while (opened < 0 && errno == EINTR);
  if (opened < 0) return errno;
  *fd = static_cast<int>(opened);
  return 0;
#else
  (void)directoryFD, (void)path, (void)flags, (void)resolve, (void)fd;
  return ENOSYS;
#endif
}

// Linux releases the descriptor even when close fails (EINTR included), so
// it is never retried: the number may already belong to another thread.
int QRVLinuxFileSystem::close(int fd) { return result(::close(fd)); }

int QRVLinuxFileSystem::makeDirectory(int directoryFD, const std::string& path, mode_t mode) {
  return result(::mkdirat(directoryFD, path.c_str(), mode));
}

int QRVLinuxFileSystem::makeTemporaryDirectory(std::string* pathTemplate) {
  return ::mkdtemp(pathTemplate->data()) ? 0 : errno;
}

int QRVLinuxFileSystem::makeTemporaryFile(std::string* pathTemplate, int flags, int* fd) {
  int opened = ::mkostemp(pathTemplate->data(), flags);
  if (opened < 0) return errno;
  *fd = opened;
  return 0;
}

int QRVLinuxFileSystem::rename(int fromDirectoryFD, const std::string& from, int toDirectoryFD, const std::string& to,
                               unsigned flags) {
  return result(::renameat2(fromDirectoryFD, from.c_str(), toDirectoryFD, to.c_str(), flags));
}

int QRVLinuxFileSystem::unlink(int directoryFD, const std::string& path, int flags) {
  return result(::unlinkat(directoryFD, path.c_str(), flags));
}

int QRVLinuxFileSystem::changeOwner(int directoryFD, const std::string& path, uid_t uid, gid_t gid, int flags) {
  return result(::fchownat(directoryFD, path.c_str(), uid, gid, flags));
}

int QRVLinuxFileSystem::changeOwnerOfFD(int fd, uid_t uid, gid_t gid) { return result(::fchown(fd, uid, gid)); }

int QRVLinuxFileSystem::changeMode(int directoryFD, const std::string& path, mode_t mode, int flags) {
  return result(::fchmodat(directoryFD, path.c_str(), mode, flags));
}

int QRVLinuxFileSystem::changeModeOfFD(int fd, mode_t mode) { return result(::fchmod(fd, mode)); }

int QRVLinuxFileSystem::status(int directoryFD, const std::string& path, struct stat* st, int flags) {
  return result(::fstatat(directoryFD, path.c_str(), st, flags));
}

int QRVLinuxFileSystem::statusOfFD(int fd, struct stat* st) { return result(::fstat(fd, st)); }

int QRVLinuxFileSystem::synchronize(int fd) { return result(::fsync(fd)); }

int QRVLinuxFileSystem::synchronizeFileSystem(int fd) { return result(::syncfs(fd)); }

int QRVLinuxFileSystem::readLink(int directoryFD, const std::string& path, std::string* target) {
  // A link's target can be as long as a path; ask for one byte more than the
  // buffer holds so that a full buffer means "longer" and we grow it.
  std::string buffer(PATH_MAX, '\0');
  for (;;) {
    ssize_t n = ::readlinkat(directoryFD, path.c_str(), buffer.data(), buffer.size());
    if (n < 0) return errno;
    if (static_cast<size_t>(n) < buffer.size()) {
      buffer.resize(static_cast<size_t>(n));
      *target = std::move(buffer);
      return 0;
    }
    buffer.resize(buffer.size() * 2);
  }
}

int QRVLinuxFileSystem::realPath(const std::string& path, std::string* resolved) {
  char* real = ::realpath(path.c_str(), nullptr);
  if (!real) return errno;
  *resolved = real;
  free(real);
  return 0;
}

int QRVLinuxFileSystem::readDirectory(int fd, std::vector<DirectoryEntry>* entries) {
  std::vector<DirectoryEntry> read;
  int e = QRVForEachDirectoryEntry(fd, [&](const dirent& entry) {
    read.push_back({entry.d_name, entry.d_type});
    return 0;
  });
  if (e) return e;
  *entries = std::move(read);
  return 0;
}

int QRVLinuxFileSystem::read(int fd, void* buffer, size_t size, size_t* done) {
  ssize_t n;
  do {
    n = ::read(fd, buffer, size);
  } while (n < 0 && errno == EINTR);
  if (n < 0) return errno;
  *done = static_cast<size_t>(n);
  return 0;
}

int QRVLinuxFileSystem::write(int fd, const void* buffer, size_t size, size_t* done) {
  ssize_t n;
  do {
    n = ::write(fd, buffer, size);
  } while (n < 0 && errno == EINTR);
  if (n < 0) return errno;
  *done = static_cast<size_t>(n);
  return 0;
}

#include "QRVFileManager.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

bool QRVFileManager::createDirectoryAtURL(const std::string& path, bool withIntermediateDirectories,
                                          mode_t mode, QRVError* error) {
  if (path.empty()) return QRVFail(error, QRV_POSIX_ERROR(EINVAL, "Cannot create a directory at an empty path"));
  if (withIntermediateDirectories) {
    for (size_t slash = path.find('/', 1); slash != std::string::npos; slash = path.find('/', slash + 1)) {
      std::string parent = path.substr(0, slash);
      if (mkdir(parent.c_str(), 0755) != 0 && errno != EEXIST)
        return QRVFail(error, QRV_POSIX_ERROR(errno, "Failed to create directory at {}: {}", parent, strerror(errno)));
    }
  }
  if (mkdir(path.c_str(), mode) == 0) {
    // The process umask must not narrow the mode the caller asked for.
    if (chmod(path.c_str(), mode) != 0)
      return QRVFail(error, QRV_POSIX_ERROR(errno, "Failed to set mode of {}: {}", path, strerror(errno)));
    return true;
  }
  int e = errno;
  struct stat st;
  if (e == EEXIST && stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode)) return true;
  return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to create directory at {}: {}", path, strerror(e)));
}

bool QRVFileManager::readFileAtURL(const std::string& path, std::vector<uint8_t>* contents, QRVError* error) {
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
  if (fd < 0) return QRVFail(error, QRV_POSIX_ERROR_QUIET(errno, "Failed to open {}: {}", path, strerror(errno)));
  contents->clear();
  uint8_t buf[16384];
  for (;;) {
    ssize_t n = read(fd, buf, sizeof buf);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      int e = errno;
      close(fd);
      return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to read {}: {}", path, strerror(e)));
    }
    if (n == 0) break;
    contents->insert(contents->end(), buf, buf + n);
  }
  close(fd);
  return true;
}

namespace {

bool writeAll(int fd, const std::vector<uint8_t>& bytes) {
  size_t done = 0;
  while (done < bytes.size()) {
    ssize_t n = write(fd, bytes.data() + done, bytes.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return false;
    done += static_cast<size_t>(n);
  }
  return true;
}

bool syncDirectoryOf(const std::string& path) {
  size_t slash = path.rfind('/');
  std::string dir = slash == std::string::npos ? "." : (slash == 0 ? "/" : path.substr(0, slash));
  int fd = open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (fd < 0) return false;
  int rc = fsync(fd);
  close(fd);
  return rc == 0;
}

}  // namespace

bool QRVFileManager::writeFileAtomically(const std::string& path, const std::vector<uint8_t>& contents, mode_t mode,
                                         QRVError* error) {
  std::string temp = path + ".tmp-XXXXXX";
  int fd = mkostemp(temp.data(), O_CLOEXEC);
  if (fd < 0) return QRVFail(error, QRV_POSIX_ERROR(errno, "Failed to create {}: {}", temp, strerror(errno)));
  if (!writeAll(fd, contents) || fchmod(fd, mode) != 0 || fsync(fd) != 0) {
    int e = errno;
    close(fd);
    unlink(temp.c_str());
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to write {}: {}", temp, strerror(e)));
  }
  close(fd);
  if (rename(temp.c_str(), path.c_str()) != 0) {
    int e = errno;
    unlink(temp.c_str());
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to move {} to {}: {}", temp, path, strerror(e)));
  }
  if (!syncDirectoryOf(path))
    return QRVFail(error, QRV_POSIX_ERROR(errno, "Failed to flush the directory of {}: {}", path, strerror(errno)));
  return true;
}

bool QRVFileManager::removeFileAtURL(const std::string& path, QRVError* error) {
  if (unlink(path.c_str()) == 0 || errno == ENOENT) return true;
  return QRVFail(error, QRV_POSIX_ERROR(errno, "Failed to remove {}: {}", path, strerror(errno)));
}

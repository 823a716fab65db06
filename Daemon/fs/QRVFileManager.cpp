// Construction, the helpers the other parts share, whole files and homes.
#include "fs/QRVFileManager.h"

#include <fcntl.h>
#include <linux/openat2.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "fs/QRVOpenDirectory.h"
#include "fs/QRVPathComponents.h"

namespace {

std::string errnoText(int e) { return strerror(e); }

// No link, and no blocking on a fifo planted in a file's place.
constexpr int kUntrustedReadFlags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;

// Failures that say the process is short of something, not what the path
// holds: asking again, one component at a time, would only fail again.
bool isResourceExhaustion(int e) { return e == EMFILE || e == ENFILE || e == ENOMEM; }

}  // namespace

QRVFileManager::QRVFileManager(std::string root, std::shared_ptr<QRVFileSystem> files,
                               std::shared_ptr<QRVFileSystemExtras> extras, std::shared_ptr<QRVAccounts> accounts,
                               std::shared_ptr<QRVFeatureFlags> featureFlags)
    : root_(std::move(root)),
      files_(std::move(files)),
      extras_(std::move(extras)),
      accounts_(std::move(accounts)),
      featureFlags_(std::move(featureFlags)) {}

std::string QRVFileManager::_underRoot(const std::string& path) const {
  std::string r = root_;
  while (r.size() > 1 && r.back() == '/') r.pop_back();
  std::string p = path.empty() || path.front() != '/' ? "/" + path : path;
  return r.empty() || r == "/" ? p : r + p;
}

// ---- Shared helpers ----

int QRVFileManager::_open(const std::string& path, int flags, int* fd) {
  return files_->open(AT_FDCWD, path, flags, 0, fd);
}

int QRVFileManager::_openDirectoryNoFollow(int directoryFD, const std::string& path, int* fd) {
  return files_->open(directoryFD, path, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC, 0, fd);
}

int QRVFileManager::_lstat(const std::string& path, struct stat* st) {
  return files_->status(AT_FDCWD, path, st, AT_SYMLINK_NOFOLLOW);
}

// Descriptors this class opened for reading or for metadata: a failed close
// loses nothing, so it is not reported.
void QRVFileManager::_close(int fd) { files_->close(fd); }

int QRVFileManager::_syncDirectory(const std::string& directory) {
  int fd = -1;
  if (int e = _open(directory, O_RDONLY | O_DIRECTORY | O_CLOEXEC, &fd)) return e;
  int e = files_->synchronize(fd);
  _close(fd);
  return e;
}

int QRVFileManager::_writeAll(int fd, const std::vector<uint8_t>& bytes) {
  size_t done = 0;
  while (done < bytes.size()) {
    size_t n = 0;
    if (int e = files_->write(fd, bytes.data() + done, bytes.size() - done, &n)) return e;
    if (n == 0) return EIO;  // no progress on a regular file means the device gave up
    done += n;
  }
  return 0;
}

// Reads `fd` to its end. More than `maxLength` bytes fail with EFBIG and
// leave `contents` empty: the file may grow while it is read. The bytes go
// straight into `contents`, sized for what the caller reserved plus one
// byte, so a file of the expected size takes one read and the call that
// sees its end.
int QRVFileManager::_readAll(int fd, size_t maxLength, std::vector<uint8_t>* contents) {
  constexpr size_t kChunk = 16384;
  const size_t expected = contents->capacity();
  const size_t limit = maxLength == SIZE_MAX ? SIZE_MAX : maxLength + 1;
  contents->clear();
  size_t used = 0;
  for (;;) {
    if (used == contents->size()) {
      if (used > maxLength) {
        contents->clear();
        return EFBIG;
      }
      contents->resize(std::min(std::max(used + kChunk, expected + 1), limit));
    }
    size_t n = 0;
    if (int e = files_->read(fd, contents->data() + used, contents->size() - used, &n)) {
      contents->clear();
      return e;
    }
    if (n == 0) {
      contents->resize(used);
      return 0;
    }
    used += n;
  }
}

// ---- Homes ----

std::string QRVFileManager::homeDirectoryURLForPOSIXUID(uid_t uid) {
  std::optional<QRVAccount> account = accounts_ ? accounts_->accountForUID(uid) : std::nullopt;
  if (!account) {
    QRVLogError("Failed to getpwuid for uid: {}", uid);
  } else if (!account->home.empty()) {
    std::string real;
    if (files_->realPath(_underRoot(account->home), &real) == 0) return real;
  }
  QRVLogError("Failed to get home dir using getpwuid for uid: {}", uid);
  return _underRoot("/private/var/mobile");
}

// ---- Whole files ----

bool QRVFileManager::readFileAtURL(const std::string& path, std::vector<uint8_t>* contents, QRVError* error) {
  int fd = -1;
  if (int e = _open(path, O_RDONLY | O_CLOEXEC | O_NOFOLLOW, &fd))
    return QRVFail(error, QRV_POSIX_ERROR_QUIET(e, "Failed to open {}: {}", path, errnoText(e)));
  int e = _readAll(fd, SIZE_MAX, contents);
  _close(fd);
  if (e) return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to read {}: {}", path, errnoText(e)));
  return true;
}

bool QRVFileManager::writeFileAtomically(const std::string& path, const std::vector<uint8_t>& contents, mode_t mode,
                                         QRVError* error) {
  std::string temp = path + ".tmp-XXXXXX";
  int fd = -1;
  if (int e = files_->makeTemporaryFile(&temp, O_CLOEXEC, &fd))
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to create {}: {}", temp, errnoText(e)));
  int written = _writeAll(fd, contents);
  if (!written) written = files_->changeModeOfFD(fd, mode);
  if (!written) written = files_->synchronize(fd);
  _close(fd);
  if (written) {
    files_->unlink(AT_FDCWD, temp, 0);
    return QRVFail(error, QRV_POSIX_ERROR(written, "Failed to write {}: {}", temp, errnoText(written)));
  }
  if (int e = files_->rename(AT_FDCWD, temp, AT_FDCWD, path, 0)) {
    files_->unlink(AT_FDCWD, temp, 0);
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to move {} to {}: {}", temp, path, errnoText(e)));
  }
  if (int e = _syncDirectory(QRVPathComponents::parentDirectory(path)))
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to flush the directory of {}: {}", path, errnoText(e)));
  return true;
}

bool QRVFileManager::readRegularFileAtURL(const std::string& path, size_t maxLength, std::vector<uint8_t>* contents,
                                          QRVError* error) {
  int directory = -1;
  if (int e =
          _open(QRVPathComponents::parentDirectory(path), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC, &directory))
    return QRVFail(error, QRV_POSIX_ERROR_QUIET(e, "Failed to open the directory of {}: {}", path, errnoText(e)));
  bool read = _readRegularFileInDirectory(directory, QRVPathComponents::last(path), path, maxLength, contents, error);
  _close(directory);
  return read;
}

bool QRVFileManager::readRegularFileBelowDirectory(const QRVOpenDirectory& directory, const std::string& child,
                                                   const std::string& name, size_t maxLength,
                                                   std::vector<uint8_t>* contents, QRVError* error) {
  const std::string path = QRVPathComponents::appending(QRVPathComponents::appending(directory.url(), child), name);
  int fd = -1;
  int e = files_->openResolved(directory.fd(), child + "/" + name, kUntrustedReadFlags,
                               RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS, &fd);
  if (!e) return _readOpenRegularFile(fd, path, maxLength, contents, error);
  if (isResourceExhaustion(e))
    return QRVFail(error, QRV_POSIX_ERROR_QUIET(e, "Failed to open {}: {}", path, errnoText(e)));
  // A link, something missing, a call the kernel lacks: one component at a
  // time tells which, in the words of a read by path.
  int container = -1;
  if ((e = files_->open(directory.fd(), child, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC, 0, &container)))
    return QRVFail(error, QRV_POSIX_ERROR_QUIET(e, "Failed to open the directory of {}: {}", path, errnoText(e)));
  bool read = _readRegularFileInDirectory(container, name, path, maxLength, contents, error);
  _close(container);
  return read;
}

bool QRVFileManager::_readRegularFileInDirectory(int directoryFD, const std::string& name, const std::string& path,
                                                 size_t maxLength, std::vector<uint8_t>* contents, QRVError* error) {
  int fd = -1;
  if (int e = files_->open(directoryFD, name, kUntrustedReadFlags, 0, &fd))
    return QRVFail(error, QRV_POSIX_ERROR_QUIET(e, "Failed to open {}: {}", path, errnoText(e)));
  return _readOpenRegularFile(fd, path, maxLength, contents, error);
}

bool QRVFileManager::_readOpenRegularFile(int fd, const std::string& path, size_t maxLength,
                                          std::vector<uint8_t>* contents, QRVError* error) {
  struct stat st;
  int e = files_->statusOfFD(fd, &st);
  if (e) {
  } else if (!S_ISREG(st.st_mode)) {
    e = EINVAL;
  } else if (static_cast<uint64_t>(st.st_size) > maxLength) {
    e = EFBIG;
  }
  if (e) {
    _close(fd);
    return QRVFail(error, QRV_POSIX_ERROR_QUIET(e, "Refusing to read {}: {}", path, errnoText(e)));
  }
  contents->reserve(static_cast<size_t>(st.st_size));
  e = _readAll(fd, maxLength, contents);
  _close(fd);
  if (e == EFBIG) return QRVFail(error, QRV_POSIX_ERROR_QUIET(e, "Refusing to read {}: {}", path, errnoText(e)));
  if (e) return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to read {}: {}", path, errnoText(e)));
  return true;
}

bool QRVFileManager::writeFileAtURL(const std::string& path, const std::vector<uint8_t>& contents, mode_t mode,
                                    QRVError* error) {
  if (int e = files_->unlink(AT_FDCWD, path, 0); e && e != ENOENT)
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to remove {}: {}", path, errnoText(e)));
  int fd = -1;
  if (int e = files_->open(AT_FDCWD, path, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode, &fd))
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to create {}: {}", path, errnoText(e)));
  int e = _writeAll(fd, contents);
  if (!e) e = files_->changeModeOfFD(fd, mode);
  if (!e) e = files_->synchronize(fd);
  // Data not yet written back can still fail at close on some file systems.
  if (int c = files_->close(fd); c && !e) e = c;
  if (e) {
    files_->unlink(AT_FDCWD, path, 0);
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to write {}: {}", path, errnoText(e)));
  }
  return true;
}

bool QRVFileManager::removeFileAtURL(const std::string& path, QRVError* error) {
  int e = files_->unlink(AT_FDCWD, path, 0);
  if (e == 0 || e == ENOENT) return true;
  return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to remove {}: {}", path, errnoText(e)));
}

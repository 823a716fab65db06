// Construction, the helpers the other parts share, whole files and homes.
#include "fs/QRVFileManager.h"

#include <fcntl.h>

#include <cerrno>
#include <cstring>

#include "fs/QRVPathComponents.h"

namespace {

std::string errnoText(int e) { return strerror(e); }

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
// leave `contents` empty: the file may grow while it is read.
int QRVFileManager::_readAll(int fd, size_t maxLength, std::vector<uint8_t>* contents) {
  contents->clear();
  uint8_t buf[16384];
  for (;;) {
    size_t n = 0;
    if (int e = files_->read(fd, buf, sizeof buf, &n)) return e;
    if (n == 0) return 0;
    if (contents->size() + n > maxLength) {
      contents->clear();
      return EFBIG;
    }
    contents->insert(contents->end(), buf, buf + n);
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
  // No link, and no blocking on a fifo planted in the file's place.
  int fd = -1;
  int e = files_->open(directory, QRVPathComponents::last(path),
                       O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC, 0, &fd);
  _close(directory);
  if (e) return QRVFail(error, QRV_POSIX_ERROR_QUIET(e, "Failed to open {}: {}", path, errnoText(e)));
  struct stat st;
  if ((e = files_->statusOfFD(fd, &st))) {
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

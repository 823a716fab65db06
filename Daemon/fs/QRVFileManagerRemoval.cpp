// Move, copy and recursive removal.
#include <fcntl.h>

#include <cerrno>
#include <cstring>

#include "fs/QRVFileManager.h"
#include "fs/QRVPathComponents.h"

namespace {

std::string errnoText(int e) { return strerror(e); }

// Opens one item for its flags without following a link and without
// blocking on a fifo.
constexpr int kOpenItemFlags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;

}  // namespace

bool QRVFileManager::_checkSource(const std::string& url, bool failIfSrcMissing, bool* done, QRVError* error) {
  *done = false;
  if (failIfSrcMissing) return true;
  struct stat st;
  int e = _lstat(url, &st);
  if (e == 0) return true;
  if (e == ENOENT) {
    *done = true;
    return true;
  }
  return QRVFail(error, QRV_POSIX_ERROR(e, "stat of {} failed: {}", url, errnoText(e)));
}

bool QRVFileManager::_moveItemAtURL(const std::string& url, const std::string& toURL, bool failIfSrcMissing,
                                    QRVError* error) {
  bool done = false;
  if (!_checkSource(url, failIfSrcMissing, &done, error)) return false;
  if (done) return true;
  const std::string destinationDirectory = QRVPathComponents::parentDirectory(toURL);
  int e = files_->rename(AT_FDCWD, url, AT_FDCWD, toURL, 0);
  if (e == 0) {
    // Renames publish containers: the new name must survive a power loss.
    // The item has moved either way, so a failed flush is only logged.
    if (int s = _syncDirectory(destinationDirectory))
      QRVLogError("Failed to flush {} after moving {} there: {}", destinationDirectory, url, errnoText(s));
    return true;
  }
  if (e == ENOENT)  // the caller decides whether a vanished source matters
    return QRVFail(error, QRV_POSIX_ERROR_QUIET(e, "rename of {} to {} failed: {}", url, toURL, errnoText(e)));
  if (e != EXDEV) return QRVFail(error, QRV_POSIX_ERROR(e, "rename of {} to {} failed: {}", url, toURL, errnoText(e)));

  if (!_copyItemAtURL(url, toURL, true, error)) return false;
  // The copy must be on disk before the only other copy goes.
  int fd = -1;
  int flushed = _open(destinationDirectory, O_RDONLY | O_DIRECTORY | O_CLOEXEC, &fd);
  if (!flushed) {
    flushed = files_->synchronizeFileSystem(fd);
    _close(fd);
  }
  if (flushed) {
    QRVLogError("Failed to flush the copy at {} : {}; keeping the move source {}", toURL, errnoText(flushed), url);
    return true;
  }
  QRVError removeError;
  if (!removeItemAtURL(url, &removeError))
    QRVLogError("Failed to remove move source after copy at {} : {}", url, removeError.description());
  return true;
}

bool QRVFileManager::_copyItemAtURL(const std::string& url, const std::string& toURL, bool failIfSrcMissing,
                                    QRVError* error) {
  bool done = false;
  if (!_checkSource(url, failIfSrcMissing, &done, error)) return false;
  if (done) return true;
  if (int e = extras_->copyItem(url, toURL))
    return QRVFail(error, QRV_POSIX_ERROR(e, "copyfile of {} to {} failed: {}", url, toURL, errnoText(e)));
  return true;
}

bool QRVFileManager::moveItemAtURL(const std::string& url, const std::string& toURL, QRVError* error) {
  return _moveItemAtURL(url, toURL, true, error);
}

bool QRVFileManager::moveItemIfExistsAtURL(const std::string& url, const std::string& toURL, QRVError* error) {
  return _moveItemAtURL(url, toURL, false, error);
}

bool QRVFileManager::copyItemAtURL(const std::string& url, const std::string& toURL, QRVError* error) {
  return _copyItemAtURL(url, toURL, true, error);
}

bool QRVFileManager::copyItemIfExistsAtURL(const std::string& url, const std::string& toURL, QRVError* error) {
  return _copyItemAtURL(url, toURL, false, error);
}

bool QRVFileManager::removeItemAtURL(const std::string& url, QRVError* error) {
  if (url.empty()) return QRVFail(error, QRV_ERROR(kNoURLForRemoval, "nil url passed to -removeItemAtURL:error:"));
  int firstError = 0;
  int e = extras_->removeTree(url, [&](const QRVFileSystemExtras::RemovalFailure& failure) {
    bool gone = _removalError(failure);
    if (!gone && firstError == 0) firstError = failure.errnum;
    return gone;
  });
  if (e && e != ENOENT) return QRVFail(error, QRV_POSIX_ERROR(e, "removefile of {} failed: {}", url, errnoText(e)));
  if (firstError && firstError != ENOENT)
    return QRVFail(error, QRV_POSIX_ERROR(firstError, "removefile of {} failed: {}", url, errnoText(firstError)));
  return true;
}

bool QRVFileManager::synchronizeDirectoryAtURL(const std::string& url, QRVError* error) {
  if (int e = _syncDirectory(url))
    return QRVFail(error, QRV_POSIX_ERROR(e, "fsync of {} failed: {}", url, errnoText(e)));
  return true;
}

bool QRVFileManager::removeEmptyDirectoryTreeAtURL(const std::string& url, QRVError* error) {
  std::vector<std::string> deepestFirst;
  const bool walked = traverseItemAtURLWithoutFollowingLinks(url, error, [&](const QRVDirectoryEntry& entry,
                                                                            QRVError* walkError) {
    switch (entry.kind) {
      case QRVDirectoryEntry::Kind::kDirectory:
        return true;
      case QRVDirectoryEntry::Kind::kDirectoryPostOrder:
        deepestFirst.emplace_back(entry.path);
        return true;
      default:
        return QRVFail(walkError, QRV_POSIX_ERROR_QUIET(ENOTEMPTY, "{} holds more than directories", url));
    }
  });
  if (!walked) return false;
  for (const std::string& directory : deepestFirst)
    if (int e = files_->unlink(AT_FDCWD, directory, AT_REMOVEDIR); e && e != ENOENT)
      return QRVFail(error, QRV_POSIX_ERROR(e, "rmdir of {} failed: {}", directory, errnoText(e)));
  return true;
}

// Called for each entry the removal could not remove; true when the entry is
// gone after all.
bool QRVFileManager::_removalError(const QRVFileSystemExtras::RemovalFailure& failure) {
  if (failure.errnum == ENOENT) return true;
  QRVLogError("removefile hit error for {} : {}", failure.path, errnoText(failure.errnum));
  if (failure.errnum != EPERM) return false;
  struct stat st;
  if (int e = files_->status(failure.directoryFD, failure.name, &st, AT_SYMLINK_NOFOLLOW)) {
    QRVLogError("Failed to stat {} before unsetting UF_IMMUTABLE: {}", failure.path, errnoText(e));
    return false;
  }
  const bool flaggable = S_ISREG(st.st_mode) || S_ISDIR(st.st_mode);
  const int unlinkFlags = S_ISDIR(st.st_mode) ? AT_REMOVEDIR : 0;
  if (flaggable && _clearImmutableAndRemove(failure.directoryFD, failure.name, failure.path, S_ISDIR(st.st_mode)))
    return true;
  // On Linux an immutable directory refuses to lose entries as well. Only a
  // directory that is itself being removed may be changed.
  if (!failure.directoryInTree) return false;
  bool immutable = false;
  if (extras_->immutableFlag(failure.directoryFD, &immutable) != 0 || !immutable) return false;
  std::string directory = QRVPathComponents::deletingLast(failure.path);
  if (int e = extras_->setImmutableFlag(failure.directoryFD, false)) {
    QRVLogError("Failed to lchflags {}: {}", directory, errnoText(e));
    return false;
  }
  QRVLogNotice("Unset UF_IMMUTABLE on {}", directory);
  int e = files_->unlink(failure.directoryFD, failure.name, unlinkFlags);
  if (e == 0) return true;
  // The entry may be immutable as well: now that its directory lets go, try it.
  if (e == EPERM && flaggable &&
      _clearImmutableAndRemove(failure.directoryFD, failure.name, failure.path, S_ISDIR(st.st_mode)))
    return true;
  QRVLogError("unlink of {} failed: {}", failure.path, errnoText(e));
  return false;
}

bool QRVFileManager::_clearImmutableAndRemove(int directoryFD, const char* name, const std::string& path,
                                              bool isDirectory) {
  int fd = -1;
  if (int e = files_->open(directoryFD, name, kOpenItemFlags, 0, &fd)) {
    QRVLogError("Failed to stat {} before unsetting UF_IMMUTABLE: {}", path, errnoText(e));
    return false;
  }
  bool immutable = false;
  int e = extras_->immutableFlag(fd, &immutable);
  if (e) {
    _close(fd);
    QRVLogError("Failed to stat {} before unsetting UF_IMMUTABLE: {}", path, errnoText(e));
    return false;
  }
  if (!immutable) {
    _close(fd);
    return false;
  }
  e = extras_->setImmutableFlag(fd, false);
  _close(fd);
  if (e) {
    QRVLogError("Failed to lchflags {}: {}", path, errnoText(e));
    return false;
  }
  QRVLogNotice("Unset UF_IMMUTABLE on {}", path);
  if (int u = files_->unlink(directoryFD, name, isDirectory ? AT_REMOVEDIR : 0)) {
    QRVLogError("unlink of {} failed: {}", path, errnoText(u));
    return false;
  }
  return true;
}

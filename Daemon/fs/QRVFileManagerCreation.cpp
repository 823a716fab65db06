// Creation of directories and temporary directories, and ownership.
#include <fcntl.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "fs/QRVFileManager.h"
#include "fs/QRVPathComponents.h"

namespace {

std::string errnoText(int e) { return strerror(e); }

bool containsMetadataFileName(std::string_view path) {
  return path.find(QRVFileManager::kMetadataFileName) != std::string_view::npos;
}

}  // namespace

// mkdir with exactly `mode`: the umask must not narrow what the caller asked
// for. Sets *created when this call made the directory. The directory is
// made private and given its mode through a descriptor that did not follow
// a link, so that a link swapped in for it meanwhile gets nothing. With
// `fd`, a directory this call made is left open there for the caller.
int QRVFileManager::_makeDirectory(const std::string& path, mode_t mode, bool* created, int* fd) {
  if (int e = files_->makeDirectory(AT_FDCWD, path, 0700)) return e;
  *created = true;
  int opened = -1;
  if (int e = _openDirectoryNoFollow(AT_FDCWD, path, &opened)) return e;
  int e = files_->changeModeOfFD(opened, mode);
  if (e || !fd) {
    _close(opened);
  } else {
    *fd = opened;
  }
  return e;
}

// The directory and its missing parents, each made with `mode`. EEXIST when
// the directory itself was there already. `fd` as for _makeDirectory.
int QRVFileManager::_makePath(const std::string& path, mode_t mode, bool* created, int* fd) {
  // The configuration asks for its directories on every access, and they
  // are nearly always there: one mkdir of the directory itself says so.
  // Only a missing parent sends the walk down from the root, which would
  // otherwise try every ancestor each time.
  int first = _makeDirectory(path, mode, created, fd);
  if (first != ENOENT || *created) return first;
  for (size_t slash = path.find('/', 1); slash != std::string::npos; slash = path.find('/', slash + 1)) {
    if (path[slash - 1] == '/') continue;
    bool ignored = false;
    int e = _makeDirectory(path.substr(0, slash), mode, &ignored, nullptr);
    if (e && e != EEXIST) return e;
  }
  return _makeDirectory(path, mode, created, fd);
}

bool QRVFileManager::createDirectoryAtURL(const std::string& url, bool withIntermediateDirectories, mode_t mode,
                                          uid_t owner, uint32_t protectionClass, QRVError* error) {
  const char* call = withIntermediateDirectories ? "mkpath_np" : "mkdir";
  if (url.empty()) return QRVFail(error, QRV_POSIX_ERROR(ENOENT, "{} of {} failed: {}", call, url, errnoText(ENOENT)));
  const bool leaveAsIs = protectionClass == kLeaveProtectionClassAlone && owner == 0;
  bool created = false;
  int fd = -1;
  int* keep = leaveAsIs ? nullptr : &fd;
  int e = withIntermediateDirectories ? _makePath(url, mode, &created, keep) : _makeDirectory(url, mode, &created, keep);
  if (e && e != EEXIST) return QRVFail(error, QRV_POSIX_ERROR(e, "{} of {} failed: {}", call, url, errnoText(e)));
  if (!created) {
    // Something was there already, nearly always the very directory, owned
    // as asked: then it is left untouched (a chown to the same owner would
    // still write its inode, on every access of a configured directory).
    struct stat st;
    if (protectionClass == kLeaveProtectionClassAlone &&
        files_->status(AT_FDCWD, url, &st, AT_SYMLINK_NOFOLLOW) == 0 && S_ISDIR(st.st_mode) &&
        (owner == 0 || (st.st_uid == owner && st.st_gid == owner)))
      return true;
    // Otherwise fine when it is a directory.
    if (files_->status(AT_FDCWD, url, &st, 0) != 0 || !S_ISDIR(st.st_mode))
      return QRVFail(error, QRV_POSIX_ERROR(EEXIST, "{} of {} failed: {}", call, url, errnoText(EEXIST)));
  }
  if (leaveAsIs) return true;
  // Class and owner are changed through a descriptor that did not follow a
  // link: a directory that was there already may lie in a container whose
  // user put a link in its place, and what the link points to is not ours to
  // give away.
  if (fd < 0 && (e = _openDirectoryNoFollow(AT_FDCWD, url, &fd)))
    return QRVFail(error, QRV_POSIX_ERROR(e, "opendir of {} failed: {}", url, errnoText(e)));
  bool ok = _setClassAndOwnerOfDirectory(fd, url, owner, protectionClass, error);
  _close(fd);
  return ok;
}

bool QRVFileManager::_setClassAndOwnerOfDirectory(int fd, const std::string& url, uid_t owner, uint32_t protectionClass,
                                                  QRVError* error) {
  if (protectionClass != kLeaveProtectionClassAlone) {
    if (int e = extras_->setProtectionClass(fd, protectionClass))
      return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to setclass({}) on directory {}: {}",
                                            static_cast<int32_t>(protectionClass), url, errnoText(e)));
  }
  if (owner != 0) {
    if (int e = files_->changeOwnerOfFD(fd, owner, owner))
      return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to chown({},{}) {}: {}", owner, owner, url, errnoText(e)));
  }
  return true;
}

bool QRVFileManager::createDirectoryBelowURL(const std::string& base, const std::string& relative, mode_t mode,
                                             uid_t owner, uint32_t protectionClass, QRVError* error) {
  std::vector<std::string> components = QRVPathComponents::split(relative);
  bool climbs = std::any_of(components.begin(), components.end(),
                            [](const std::string& c) { return c == "/" || c == "." || c == ".."; });
  if (components.empty() || climbs)
    return QRVFail(error,
                   QRV_POSIX_ERROR(EINVAL, "mkdir of {} below {} failed: {}", relative, base, errnoText(EINVAL)));
  int fd = -1;
  if (int e = _openDirectoryNoFollow(AT_FDCWD, base, &fd))
    return QRVFail(error, QRV_POSIX_ERROR(e, "opendir of {} failed: {}", base, errnoText(e)));
  // One component at a time, each opened without following a link: a link
  // anywhere below `base` stops the walk instead of taking it elsewhere.
  std::string path = base;
  for (const std::string& name : components) {
    path = QRVPathComponents::appending(path, name);
    int e = files_->makeDirectory(fd, name, 0700);
    bool created = e == 0;
    if (e == EEXIST) e = 0;
    int child = -1;
    if (!e) {
      e = _openDirectoryNoFollow(fd, name, &child);
      if (e == ENOTDIR) e = EEXIST;
    }
    if (!e && created) e = files_->changeModeOfFD(child, mode);
    _close(fd);
    fd = child;
    if (e) {
      if (fd >= 0) _close(fd);
      return QRVFail(error, QRV_POSIX_ERROR(e, "mkdir of {} failed: {}", path, errnoText(e)));
    }
  }
  bool ok = _setClassAndOwnerOfDirectory(fd, path, owner, protectionClass, error);
  _close(fd);
  return ok;
}

bool QRVFileManager::createDirectoryAtURL(const std::string& url, bool withIntermediateDirectories, mode_t mode,
                                          QRVError* error) {
  return createDirectoryAtURL(url, withIntermediateDirectories, mode, 0, kLeaveProtectionClassAlone, error);
}

bool QRVFileManager::createDirectoryAtURLWithClass(const std::string& url, bool withIntermediateDirectories,
                                                   mode_t mode, uint32_t protectionClass, QRVError* error) {
  return createDirectoryAtURL(url, withIntermediateDirectories, mode, 0, protectionClass, error);
}

bool QRVFileManager::createDirectoryAtURLWithOwner(const std::string& url, bool withIntermediateDirectories,
                                                   mode_t mode, uid_t owner, QRVError* error) {
  return createDirectoryAtURL(url, withIntermediateDirectories, mode, owner, kLeaveProtectionClassAlone, error);
}

std::optional<std::string> QRVFileManager::createTemporaryDirectoryInDirectoryURL(const std::string& directory,
                                                                                  QRVError* error) {
  return createTemporaryDirectoryInDirectoryURL(directory, "temp.", error);
}

std::optional<std::string> QRVFileManager::createTemporaryDirectoryInDirectoryURL(const std::string& directory,
                                                                                  const std::string& withNamePrefix,
                                                                                  QRVError* error) {
  std::string path = QRVPathComponents::appending(directory, withNamePrefix + "XXXXXX");
  if (int e = files_->makeTemporaryDirectory(&path)) {
    QRVFail(error, QRV_POSIX_ERROR(e, "Failed to create temp dir at path {} : {}", path, errnoText(e)));
    return std::nullopt;
  }
  return path;
}

// ---- Ownership ----

bool QRVFileManager::setOwnerOfDirectoryAtURL(const std::string& url, uid_t uid, gid_t gid, QRVError* error) {
  int fd = -1;
  if (int e = _openDirectoryNoFollow(AT_FDCWD, url, &fd))
    return QRVFail(error, QRV_POSIX_ERROR(e, "open of {} failed: {}", url, errnoText(e)));
  int e = files_->changeOwnerOfFD(fd, uid, gid);
  _close(fd);
  if (e) return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to chown({},{}) {}: {}", uid, gid, url, errnoText(e)));
  return true;
}

bool QRVFileManager::setModeOfDirectoryAtURL(const std::string& url, mode_t mode, QRVError* error) {
  int fd = -1;
  if (int e = _openDirectoryNoFollow(AT_FDCWD, url, &fd))
    return QRVFail(error, QRV_POSIX_ERROR(e, "open of {} failed: {}", url, errnoText(e)));
  int e = files_->changeModeOfFD(fd, mode);
  _close(fd);
  if (e) return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to chmod({:o}) {}: {}", mode, url, errnoText(e)));
  return true;
}

// Directories and anything executable get 0755, everything else 0644. Links
// are left alone: Linux gives them no mode of their own.
void QRVFileManager::_standardizeMode(const std::string& path, const struct stat& st) {
  if (S_ISLNK(st.st_mode)) return;
  mode_t mode = (S_ISDIR(st.st_mode) || (st.st_mode & 0111)) ? 0755 : 0644;
  if ((st.st_mode & 07777) == mode) return;
  if (int e = files_->changeMode(AT_FDCWD, path, mode, AT_SYMLINK_NOFOLLOW))
    QRVLogError("Could not chmod {}: {}", path, errnoText(e));
}

bool QRVFileManager::standardizeOwnershipAtURL(const std::string& url, uid_t toUID, gid_t GID, QRVError* error) {
  bool ok = _traverseDirectory(url, error, [&](const QRVDirectoryEntry& entry, QRVError*) {
    if (entry.kind == QRVDirectoryEntry::Kind::kDirectoryPostOrder || containsMetadataFileName(entry.path)) return true;
    std::string path(entry.path);
    if (entry.stat->st_uid != toUID || entry.stat->st_gid != GID) {
      if (int e = files_->changeOwner(AT_FDCWD, path, toUID, GID, AT_SYMLINK_NOFOLLOW))
        QRVLogError("Could not chown {}: {}", path, errnoText(e));
    }
    _standardizeMode(path, *entry.stat);
    return true;
  });
  struct stat st;
  if (int e = _lstat(url, &st)) return QRVFail(error, QRV_POSIX_ERROR(e, "Could not stat {}: {}", url, errnoText(e)));
  if (!containsMetadataFileName(url)) {
    if (st.st_uid != toUID) {
      if (int e = files_->changeOwner(AT_FDCWD, url, toUID, GID, AT_SYMLINK_NOFOLLOW))
        QRVLogError("Could not chown {}: {}", url, errnoText(e));
    }
    _standardizeMode(url, st);
  }
  return ok;
}

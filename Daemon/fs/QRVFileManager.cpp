#include "fs/QRVFileManager.h"

#include <dirent.h>
#include <fcntl.h>
#include <fts.h>
#include <limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace {

using QRVACLPermission::kAppendData;
using QRVACLPermission::kChangeOwner;
using QRVACLPermission::kDelete;
using QRVACLPermission::kDeleteChild;
using QRVACLPermission::kExecute;
using QRVACLPermission::kReadAttributes;
using QRVACLPermission::kReadData;
using QRVACLPermission::kReadExtendedAttributes;
using QRVACLPermission::kReadSecurity;
using QRVACLPermission::kWriteAttributes;
using QRVACLPermission::kWriteData;
using QRVACLPermission::kWriteExtendedAttributes;
using QRVACLPermission::kWriteSecurity;

// Everything a system service may do in a directory of a system container.
constexpr uint32_t kSystemDirectoryRights = kReadData | kWriteData | kExecute | kDelete | kAppendData | kDeleteChild |
                                            kReadAttributes | kWriteAttributes | kReadExtendedAttributes |
                                            kWriteExtendedAttributes | kReadSecurity | kWriteSecurity | kChangeOwner;
// The same for a file, where "delete child" means nothing.
constexpr uint32_t kSystemFileRights = kSystemDirectoryRights & ~kDeleteChild;
// On the container directory itself: add entries and use extended
// attributes, but not list or remove what others put there.
constexpr uint32_t kSystemTopLevelRights =
    kWriteData | kAppendData | kReadExtendedAttributes | kWriteExtendedAttributes;
static_assert(kSystemDirectoryRights == 0x3FFE && kSystemFileRights == 0x3FBE && kSystemTopLevelRights == 0x624);

constexpr uint32_t kInheritToChildren = QRVACLFlag::kFileInherit | QRVACLFlag::kDirectoryInherit;
static_assert(kInheritToChildren == 0x60 && (kInheritToChildren | QRVACLFlag::kOnlyInherit) == 0x160);

std::string errnoText(int e) { return strerror(e); }

// A missing path as the logs show it.
std::string orNil(const std::string& s) { return s.empty() ? "(null)" : s; }

// Components as the path-safety rules count them: a leading "/" is a
// component of its own, empty components vanish, a trailing "/" adds nothing.
std::vector<std::string> pathComponents(std::string_view path) {
  std::vector<std::string> components;
  if (!path.empty() && path.front() == '/') components.emplace_back("/");
  size_t start = 0;
  while (start < path.size()) {
    size_t end = path.find('/', start);
    if (end == std::string_view::npos) end = path.size();
    if (end > start) components.emplace_back(path.substr(start, end - start));
    start = end + 1;
  }
  return components;
}

// Joins components [begin, end) back into a path.
std::string joinComponents(const std::vector<std::string>& components, size_t begin, size_t end) {
  std::string path;
  for (size_t i = begin; i < end; i++) {
    if (components[i] == "/") {
      path = "/";
      continue;
    }
    if (!path.empty() && path.back() != '/') path += '/';
    path += components[i];
  }
  return path;
}

std::string deletingLastPathComponent(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  size_t slash = path.rfind('/');
  if (slash == std::string::npos) return "";
  return slash == 0 ? "/" : path.substr(0, slash);
}

std::string appendingPathComponent(const std::string& path, const std::string& component) {
  if (path.empty()) return component;
  if (path.back() == '/') return path + component;
  return path + "/" + component;
}

std::string lastPathComponent(const std::string& path) {
  std::vector<std::string> components = pathComponents(path);
  return components.empty() ? "" : components.back();
}

// The "/private" prefix names the same place as the path without it.
std::string withoutPrivatePrefix(const std::string& path) {
  return path.rfind("/private/", 0) == 0 ? path.substr(8) : path;
}

bool containsMetadataFileName(std::string_view path) {
  return path.find(QRVFileManager::kMetadataFileName) != std::string_view::npos;
}

// Opens one item for its class or flags without following a link and
// without blocking on a fifo.
int openItem(int directoryFD, const char* name) {
  return openat(directoryFD, name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC);
}

// mkdir with exactly `mode`: the umask must not narrow what the caller asked
// for. Sets *created when this call made the directory. The directory is
// made private and given its mode through a descriptor that did not follow
// a link, so that a link swapped in for it meanwhile gets nothing.
int makeDirectory(const std::string& path, mode_t mode, bool* created) {
  if (mkdir(path.c_str(), 0700) != 0) return errno;
  *created = true;
  int fd = open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (fd < 0) return errno;
  int e = fchmod(fd, mode) == 0 ? 0 : errno;
  close(fd);
  return e;
}

// The directory and its missing parents, each made with `mode`. EEXIST when
// the directory itself was there already.
int makePath(const std::string& path, mode_t mode, bool* created) {
  for (size_t slash = path.find('/', 1); slash != std::string::npos; slash = path.find('/', slash + 1)) {
    if (path[slash - 1] == '/') continue;
    bool ignored = false;
    int e = makeDirectory(path.substr(0, slash), mode, &ignored);
    if (e && e != EEXIST) return e;
  }
  return makeDirectory(path, mode, created);
}

int syncDirectory(const std::string& directory) {
  int fd = open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (fd < 0) return errno;
  int e = fsync(fd) == 0 ? 0 : errno;
  close(fd);
  return e;
}

std::string parentDirectory(const std::string& path) {
  std::string parent = deletingLastPathComponent(path);
  return parent.empty() ? "." : parent;
}

QRVDirectoryEntry::Kind kindOfEntry(int ftsInfo) {
  switch (ftsInfo) {
    case FTS_D:
      return QRVDirectoryEntry::Kind::kDirectory;
    case FTS_DP:
      return QRVDirectoryEntry::Kind::kDirectoryPostOrder;
    case FTS_F:
      return QRVDirectoryEntry::Kind::kRegularFile;
    case FTS_SL:
    case FTS_SLNONE:
      return QRVDirectoryEntry::Kind::kSymbolicLink;
    case FTS_DC:
      return QRVDirectoryEntry::Kind::kDirectoryCycle;
    case FTS_DNR:
      return QRVDirectoryEntry::Kind::kUnreadableDirectory;
    default:
      return QRVDirectoryEntry::Kind::kOther;
  }
}

}  // namespace

QRVFileManager::QRVFileManager(std::string root, std::shared_ptr<QRVFileSystemExtras> fileSystem,
                               std::shared_ptr<QRVAccounts> accounts, std::shared_ptr<QRVFeatureFlags> featureFlags)
    : root_(std::move(root)),
      fileSystem_(std::move(fileSystem)),
      accounts_(std::move(accounts)),
      featureFlags_(std::move(featureFlags)) {}

std::string QRVFileManager::_underRoot(const std::string& path) const {
  std::string r = root_;
  while (r.size() > 1 && r.back() == '/') r.pop_back();
  std::string p = path.empty() || path.front() != '/' ? "/" + path : path;
  return r.empty() || r == "/" ? p : r + p;
}

// ---- Paths supplied by clients ----

bool QRVFileManager::_validateSymlink(const std::string& path, int64_t startingDepth, int64_t* endingDepth) {
  int64_t depth = startingDepth;
  for (const std::string& component : pathComponents(path)) {
    if (component == "..")
      depth--;
    else if (component != "." && component != "/")
      depth++;
    if (depth < startingDepth) return false;
  }
  if (endingDepth) *endingDepth = depth;
  return true;
}

std::optional<std::string> QRVFileManager::_realPathForURL(const std::string& url,
                                                           bool allowNonExistentPathComponents) {
  char buffer[PATH_MAX] = {};
  if (realpath(url.c_str(), buffer)) return std::string(buffer);
  int e = errno;
  if (e == ENOENT && allowNonExistentPathComponents) return _realPathWhatExistsInPath(url);
  QRVLogError("Failed to realpath {} : {} at {}", url, errnoText(e), buffer);
  return std::nullopt;
}

std::optional<std::string> QRVFileManager::_realPathWhatExistsInPath(const std::string& path) {
  std::vector<std::string> components = pathComponents(path);
  for (size_t length = components.size(); length >= 2; length--) {
    std::string prefix = joinComponents(components, 0, length);
    struct stat st;
    if (lstat(prefix.c_str(), &st) != 0) continue;
    // The longest existing prefix decides. When it does not resolve (a
    // dangling or looping link) nothing does: resolving a shorter prefix
    // would hand back that link as if it were a name yet to be created, and
    // whatever is made there would land wherever the link points.
    std::optional<std::string> real = _realPathForURL(prefix, false);
    if (!real) return std::nullopt;
    std::string rest = joinComponents(components, length, components.size());
    if (rest.empty()) return real;
    QRVLogDebug("Realpathed {} ; appending non-existing components {}", *real, rest);
    return appendingPathComponent(*real, rest);
  }
  return std::nullopt;
}

std::optional<std::string> QRVFileManager::realPathForURL(const std::string& url, const std::string& ifChildOfURL) {
  if (url.empty() || ifChildOfURL.empty()) {
    QRVLogError("The base path {} and/or suspicious path {} were nil", orNil(ifChildOfURL), orNil(url));
    return std::nullopt;
  }
  const std::string suspiciousPath = withoutPrivatePrefix(url);
  const std::string basePath = withoutPrivatePrefix(ifChildOfURL);
  if (suspiciousPath.compare(0, basePath.size(), basePath) != 0) {
    QRVLogError("supiscious path {} does not contain base path {} as a prefix", suspiciousPath, basePath);
    return std::nullopt;
  }
  for (const std::string& component : pathComponents(suspiciousPath)) {
    if (component == "..") {
      QRVLogError("The suspicious path {} contains '..' paths, which are invalid", suspiciousPath);
      return std::nullopt;
    }
  }

  char target[1024] = {};
  if (readlink(suspiciousPath.c_str(), target, sizeof target - 1) >= 0) {
    if (target[0] == '/') {
      QRVLogError("Rejecting {} -> {}, as absolute symlinks are not allowed", suspiciousPath, target);
      return std::nullopt;
    }
    int64_t baseDepth = 0;
    if (!_validateSymlink(basePath, 0, &baseDepth)) {
      QRVLogError("Failed to retrieve depth of {}", basePath);
      return std::nullopt;
    }
    // The link as seen from the base: its directory inside the base, then
    // the target, which must not climb above the base.
    std::string seenFromBase =
        appendingPathComponent(deletingLastPathComponent(suspiciousPath.substr(basePath.size())), target);
    if (!_validateSymlink(seenFromBase, baseDepth, nullptr)) {
      QRVLogError("Rejecting {} -> {}, as it is points outside or to the base {}", suspiciousPath, seenFromBase,
                  basePath);
      return std::nullopt;
    }
  } else if (errno != EINVAL && errno != ENOENT) {
    QRVLogError("Readlink failed: {}", errnoText(errno));
    return std::nullopt;
  }

  std::optional<std::string> realBase = _realPathForURL(basePath, false);
  if (!realBase) {
    QRVLogError("Failed to retrieve realpath for base path {} ", basePath);
    return std::nullopt;
  }
  std::optional<std::string> realSuspicious = _realPathForURL(suspiciousPath, true);
  if (!realSuspicious) {
    QRVLogError("Failed to retrieve realpath for suspicious path {}", suspiciousPath);
    return std::nullopt;
  }

  // The resolved paths must agree on every component of the base. A link
  // that passed the depth walk is compared as well: its target may itself be
  // a link that leads elsewhere.
  std::vector<std::string> base = pathComponents(*realBase);
  std::vector<std::string> suspicious = pathComponents(*realSuspicious);
  if (base.size() < 2 || suspicious.size() < 2) {
    QRVLogError("Rejecting {} with base {} because real component counts don't make sense (reals {} ; {})",
                suspiciousPath, basePath, *realSuspicious, *realBase);
    return std::nullopt;
  }
  size_t b = base[1] == "private" ? 2 : 1;
  size_t s = suspicious[1] == "private" ? 2 : 1;
  if (base.size() - b > suspicious.size() - s) {
    QRVLogError(
        "Rejecting {} with base {} because base component count is greater than child component count (reals {} ; "
        "{})",
        suspiciousPath, basePath, *realSuspicious, *realBase);
    return std::nullopt;
  }
  for (; b < base.size(); b++, s++) {
    if (base[b] != suspicious[s]) {
      QRVLogError("Rejecting {} with base {} (reals {} ; {}) because components diverge at {} != {}", suspiciousPath,
                  basePath, *realSuspicious, *realBase, suspicious[s], base[b]);
      return std::nullopt;
    }
  }
  return realSuspicious;
}

bool QRVFileManager::itemExistsAtURL(const std::string& url) {
  struct stat st;
  if (lstat(url.c_str(), &st) == 0) return true;
  if (errno != ENOENT) QRVLogError("Failed to determine if {} exists: {}", url, errnoText(errno));
  return false;
}

bool QRVFileManager::directoryExistsAtURL(const std::string& url) {
  struct stat st;
  return lstat(url.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

bool QRVFileManager::setOwnerAndModeOfDirectoryAtURL(const std::string& url, uid_t uid, gid_t gid, mode_t mode,
                                                     QRVError* error) {
  int fd = open(url.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (fd < 0) return QRVFail(error, QRV_POSIX_ERROR(errno, "open of {} failed: {}", url, errnoText(errno)));
  bool ok = true;
  if (fchown(fd, uid, gid) != 0) {
    ok = QRVFail(error, QRV_POSIX_ERROR(errno, "Failed to chown({},{}) {}: {}", uid, gid, url, errnoText(errno)));
  } else if (fchmod(fd, mode) != 0) {
    ok = QRVFail(error, QRV_POSIX_ERROR(errno, "Failed to chmod({:o}) {}: {}", mode, url, errnoText(errno)));
  }
  close(fd);
  return ok;
}

bool QRVFileManager::itemDoesNotExistAtURL(const std::string& url) {
  struct stat st;
  if (lstat(url.c_str(), &st) == 0) return false;
  if (errno == ENOENT) return true;
  QRVLogError("Failed to determine if {} exists: {}", url, errnoText(errno));
  return false;
}

// ---- Listing and traversal ----

std::optional<std::vector<std::string>> QRVFileManager::urlsForItemsInDirectoryAtURL(const std::string& url,
                                                                                     QRVError* error) {
  DIR* dir = opendir(url.c_str());
  if (!dir) {
    int e = errno;
    if (e == ENOENT) {
      QRVFail(error, QRV_POSIX_ERROR_QUIET(e, "_IterateDirectory for {} returned {}", url, errnoText(e)));
    } else {
      QRVLogError("opendir of {} failed: {}", url, errnoText(e));
      QRVFail(error, QRV_POSIX_ERROR(e, "_IterateDirectory for {} returned {}", url, errnoText(e)));
    }
    return std::nullopt;
  }
  std::vector<std::string> urls;
  int e = 0;
  for (;;) {
    errno = 0;
    dirent* entry = readdir(dir);
    if (!entry) {
      e = errno;
      break;
    }
    if (entry->d_name[0] == '.') continue;
    unsigned char type = entry->d_type;
    if (type == DT_UNKNOWN) {
      struct stat st;
      if (fstatat(dirfd(dir), entry->d_name, &st, AT_SYMLINK_NOFOLLOW) != 0) continue;
      type = S_ISDIR(st.st_mode) ? DT_DIR : S_ISREG(st.st_mode) ? DT_REG : S_ISLNK(st.st_mode) ? DT_LNK : DT_UNKNOWN;
    }
    if (type == DT_DIR || type == DT_REG || type == DT_LNK) urls.push_back(appendingPathComponent(url, entry->d_name));
  }
  closedir(dir);
  if (e) {
    QRVFail(error, QRV_POSIX_ERROR(e, "_IterateDirectory for {} returned {}", url, errnoText(e)));
    return std::nullopt;
  }
  std::sort(urls.begin(), urls.end());
  return urls;
}

bool QRVFileManager::_traverseDirectory(const std::string& url, QRVError* error, const TraversalBlock& block) {
  std::string start = url;
  char* const paths[] = {start.data(), nullptr};
  FTS* fts = fts_open(paths, FTS_NOCHDIR | FTS_PHYSICAL | FTS_XDEV, nullptr);
  if (!fts) {
    int e = errno;
    return QRVFail(error, QRV_POSIX_ERROR(e, "fts_open failed for {} with error {}", url, errnoText(e)));
  }
  bool ok = true;
  QRVError walkError;
  for (;;) {
    errno = 0;
    FTSENT* entry = fts_read(fts);
    if (!entry) {
      if (errno) {
        int e = errno;
        ok = false;
        walkError = QRV_POSIX_ERROR(e, "fts_read failed for {} with error {}", url, errnoText(e));
      }
      break;
    }
    if (entry->fts_info == FTS_ERR || entry->fts_info == FTS_NS) {
      ok = false;
      walkError =
          QRV_POSIX_ERROR(entry->fts_errno, "Error for path {}: {}", entry->fts_path, errnoText(entry->fts_errno));
      break;
    }
    QRVDirectoryEntry item{kindOfEntry(entry->fts_info), std::string_view(entry->fts_path, entry->fts_pathlen),
                           static_cast<int>(entry->fts_level), entry->fts_statp, entry->fts_errno};
    if (!block(item, &walkError)) {
      ok = false;
      break;
    }
  }
  if (fts_close(fts) != 0 && ok) {
    int e = errno;
    ok = false;
    walkError = QRV_POSIX_ERROR(e, "fts_close failed for {} with error {}", url, errnoText(e));
  }
  if (!ok && error) *error = std::move(walkError);
  return ok;
}

// ---- Creation ----

bool QRVFileManager::createDirectoryAtURL(const std::string& url, bool withIntermediateDirectories, mode_t mode,
                                          uid_t owner, uint32_t protectionClass, QRVError* error) {
  const char* call = withIntermediateDirectories ? "mkpath_np" : "mkdir";
  if (url.empty()) return QRVFail(error, QRV_POSIX_ERROR(ENOENT, "{} of {} failed: {}", call, url, errnoText(ENOENT)));
  bool created = false;
  int e = withIntermediateDirectories ? makePath(url, mode, &created) : makeDirectory(url, mode, &created);
  if (e && e != EEXIST) return QRVFail(error, QRV_POSIX_ERROR(e, "{} of {} failed: {}", call, url, errnoText(e)));
  if (!created) {
    // Something was there already: fine when it is a directory.
    struct stat st;
    if (stat(url.c_str(), &st) != 0 || !S_ISDIR(st.st_mode))
      return QRVFail(error, QRV_POSIX_ERROR(EEXIST, "{} of {} failed: {}", call, url, errnoText(EEXIST)));
  }
  if (protectionClass == kLeaveProtectionClassAlone && owner == 0) return true;
  // Class and owner are changed through a descriptor that did not follow a
  // link: a directory that was there already may lie in a container whose
  // user put a link in its place, and what the link points to is not ours to
  // give away.
  int fd = open(url.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (fd < 0) {
    e = errno;
    return QRVFail(error, QRV_POSIX_ERROR(e, "opendir of {} failed: {}", url, errnoText(e)));
  }
  bool ok = _setClassAndOwnerOfDirectory(fd, url, owner, protectionClass, error);
  close(fd);
  return ok;
}

bool QRVFileManager::_setClassAndOwnerOfDirectory(int fd, const std::string& url, uid_t owner,
                                                  uint32_t protectionClass, QRVError* error) {
  if (protectionClass != kLeaveProtectionClassAlone) {
    if (int e = fileSystem_->setProtectionClass(fd, protectionClass))
      return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to setclass({}) on directory {}: {}",
                                            static_cast<int32_t>(protectionClass), url, errnoText(e)));
  }
  if (owner != 0 && fchown(fd, owner, owner) != 0) {
    int e = errno;
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to chown({},{}) {}: {}", owner, owner, url, errnoText(e)));
  }
  return true;
}

bool QRVFileManager::createDirectoryBelowURL(const std::string& base, const std::string& relative, mode_t mode,
                                             uid_t owner, uint32_t protectionClass, QRVError* error) {
  std::vector<std::string> components = pathComponents(relative);
  bool climbs = std::any_of(components.begin(), components.end(),
                            [](const std::string& c) { return c == "/" || c == "." || c == ".."; });
  if (components.empty() || climbs)
    return QRVFail(error, QRV_POSIX_ERROR(EINVAL, "mkdir of {} below {} failed: {}", relative, base, errnoText(EINVAL)));
  int fd = open(base.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (fd < 0) {
    int e = errno;
    return QRVFail(error, QRV_POSIX_ERROR(e, "opendir of {} failed: {}", base, errnoText(e)));
  }
  // One component at a time, each opened without following a link: a link
  // anywhere below `base` stops the walk instead of taking it elsewhere.
  std::string path = base;
  for (const std::string& name : components) {
    path = appendingPathComponent(path, name);
    bool created = mkdirat(fd, name.c_str(), 0700) == 0;
    int e = created || errno == EEXIST ? 0 : errno;
    int child = e ? -1 : openat(fd, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (!e && child < 0) e = errno == ENOTDIR ? EEXIST : errno;
    if (!e && created && fchmod(child, mode) != 0) e = errno;
    close(fd);
    fd = child;
    if (e) {
      if (fd >= 0) close(fd);
      return QRVFail(error, QRV_POSIX_ERROR(e, "mkdir of {} failed: {}", path, errnoText(e)));
    }
  }
  bool ok = _setClassAndOwnerOfDirectory(fd, path, owner, protectionClass, error);
  close(fd);
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
  std::string path = appendingPathComponent(directory, withNamePrefix + "XXXXXX");
  if (!mkdtemp(path.data())) {
    int e = errno;
    QRVFail(error, QRV_POSIX_ERROR(e, "Failed to create temp dir at path {} : {}", path, errnoText(e)));
    return std::nullopt;
  }
  return path;
}

// ---- Move, copy, remove ----

bool QRVFileManager::_checkSource(const std::string& url, bool failIfSrcMissing, bool* done, QRVError* error) {
  *done = false;
  if (failIfSrcMissing) return true;
  struct stat st;
  if (lstat(url.c_str(), &st) == 0) return true;
  int e = errno;
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
  if (rename(url.c_str(), toURL.c_str()) == 0) {
    // Renames publish containers: the new name must survive a power loss.
    // The item has moved either way, so a failed flush is only logged.
    if (int e = syncDirectory(parentDirectory(toURL)))
      QRVLogError("Failed to flush {} after moving {} there: {}", parentDirectory(toURL), url, errnoText(e));
    return true;
  }
  int e = errno;
  if (e == ENOENT)  // the caller decides whether a vanished source matters
    return QRVFail(error, QRV_POSIX_ERROR_QUIET(e, "rename of {} to {} failed: {}", url, toURL, errnoText(e)));
  if (e != EXDEV) return QRVFail(error, QRV_POSIX_ERROR(e, "rename of {} to {} failed: {}", url, toURL, errnoText(e)));

  if (!_copyItemAtURL(url, toURL, true, error)) return false;
  // The copy must be on disk before the only other copy goes.
  int fd = open(parentDirectory(toURL).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  int flushed = fd < 0 ? errno : (syncfs(fd) == 0 ? 0 : errno);
  if (fd >= 0) close(fd);
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
  if (int e = fileSystem_->copyItem(url, toURL))
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
  int e = fileSystem_->removeTree(url, [&](const QRVFileSystemExtras::RemovalFailure& failure) {
    bool gone = _removalError(failure);
    if (!gone && firstError == 0) firstError = failure.errnum;
    return gone;
  });
  if (e && e != ENOENT) return QRVFail(error, QRV_POSIX_ERROR(e, "removefile of {} failed: {}", url, errnoText(e)));
  if (firstError && firstError != ENOENT)
    return QRVFail(error, QRV_POSIX_ERROR(firstError, "removefile of {} failed: {}", url, errnoText(firstError)));
  return true;
}

// Called for each entry the removal could not remove; true when the entry is
// gone after all.
bool QRVFileManager::_removalError(const QRVFileSystemExtras::RemovalFailure& failure) {
  if (failure.errnum == ENOENT) return true;
  QRVLogError("removefile hit error for {} : {}", failure.path, errnoText(failure.errnum));
  if (failure.errnum != EPERM) return false;
  struct stat st;
  if (fstatat(failure.directoryFD, failure.name, &st, AT_SYMLINK_NOFOLLOW) != 0) {
    QRVLogError("Failed to stat {} before unsetting UF_IMMUTABLE: {}", failure.path, errnoText(errno));
    return false;
  }
  if ((S_ISREG(st.st_mode) || S_ISDIR(st.st_mode)) &&
      _clearImmutableAndRemove(failure.directoryFD, failure.name, failure.path, S_ISDIR(st.st_mode)))
    return true;
  // On Linux an immutable directory refuses to lose entries as well. Only a
  // directory that is itself being removed may be changed.
  if (!failure.directoryInTree) return false;
  bool immutable = false;
  if (fileSystem_->immutableFlag(failure.directoryFD, &immutable) != 0 || !immutable) return false;
  std::string directory = deletingLastPathComponent(failure.path);
  if (int e = fileSystem_->setImmutableFlag(failure.directoryFD, false)) {
    QRVLogError("Failed to lchflags {}: {}", directory, errnoText(e));
    return false;
  }
  QRVLogNotice("Unset UF_IMMUTABLE on {}", directory);
  if (unlinkat(failure.directoryFD, failure.name, S_ISDIR(st.st_mode) ? AT_REMOVEDIR : 0) == 0) return true;
  int e = errno;
  // The entry may be immutable as well: now that its directory lets go, try it.
  if (e == EPERM && (S_ISREG(st.st_mode) || S_ISDIR(st.st_mode)) &&
      _clearImmutableAndRemove(failure.directoryFD, failure.name, failure.path, S_ISDIR(st.st_mode)))
    return true;
  QRVLogError("unlink of {} failed: {}", failure.path, errnoText(e));
  return false;
}

bool QRVFileManager::_clearImmutableAndRemove(int directoryFD, const char* name, const std::string& path,
                                              bool isDirectory) {
  int fd = openItem(directoryFD, name);
  if (fd < 0) {
    QRVLogError("Failed to stat {} before unsetting UF_IMMUTABLE: {}", path, errnoText(errno));
    return false;
  }
  bool immutable = false;
  int e = fileSystem_->immutableFlag(fd, &immutable);
  if (e) {
    close(fd);
    QRVLogError("Failed to stat {} before unsetting UF_IMMUTABLE: {}", path, errnoText(e));
    return false;
  }
  if (!immutable) {
    close(fd);
    return false;
  }
  e = fileSystem_->setImmutableFlag(fd, false);
  close(fd);
  if (e) {
    QRVLogError("Failed to lchflags {}: {}", path, errnoText(e));
    return false;
  }
  QRVLogNotice("Unset UF_IMMUTABLE on {}", path);
  if (unlinkat(directoryFD, name, isDirectory ? AT_REMOVEDIR : 0) != 0) {
    QRVLogError("unlink of {} failed: {}", path, errnoText(errno));
    return false;
  }
  return true;
}

// ---- Data-protection classes ----

bool QRVFileManager::setDataProtectionClassOfItemAtURL(const std::string& url, uint32_t toClass,
                                                       const std::function<bool(uint32_t)>& ifPredicate,
                                                       QRVError* error) {
  int fd = openItem(AT_FDCWD, url.c_str());
  if (fd < 0) {
    int e = errno;
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to open {} : {}", url, errnoText(e)));
  }
  if (ifPredicate) {
    uint32_t current = 0;
    if (int e = fileSystem_->protectionClass(fd, &current)) {
      close(fd);
      return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to getclass of file {}: {}", url, errnoText(e)));
    }
    if (!ifPredicate(current)) {
      close(fd);
      return true;
    }
  }
  int e = fileSystem_->setProtectionClass(fd, toClass);
  close(fd);
  if (e)
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to setclass({}) on file {}: {}", static_cast<int32_t>(toClass),
                                          url, errnoText(e)));
  return true;
}

bool QRVFileManager::dataProtectionClassOfItemAtURL(const std::string& url, uint32_t* protectionClass,
                                                    QRVError* error) {
  int fd = openItem(AT_FDCWD, url.c_str());
  if (fd < 0) {
    int e = errno;
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to open {} : {}", url, errnoText(e)));
  }
  int e = fileSystem_->protectionClass(fd, protectionClass);
  close(fd);
  if (e) return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to getclass of file {}: {}", url, errnoText(e)));
  return true;
}

// ---- Ownership and ACLs ----

namespace {

// Directories and anything executable get 0755, everything else 0644. Links
// are left alone: Linux gives them no mode of their own.
void standardizeMode(const char* path, const struct stat& st) {
  if (S_ISLNK(st.st_mode)) return;
  mode_t mode = (S_ISDIR(st.st_mode) || (st.st_mode & 0111)) ? 0755 : 0644;
  if ((st.st_mode & 07777) == mode) return;
  if (fchmodat(AT_FDCWD, path, mode, AT_SYMLINK_NOFOLLOW) != 0)
    QRVLogError("Could not chmod {}: {}", path, errnoText(errno));
}

}  // namespace

bool QRVFileManager::standardizeOwnershipAtURL(const std::string& url, uid_t toUID, gid_t GID, QRVError* error) {
  bool ok = _traverseDirectory(url, error, [&](const QRVDirectoryEntry& entry, QRVError*) {
    if (entry.kind == QRVDirectoryEntry::Kind::kDirectoryPostOrder || containsMetadataFileName(entry.path)) return true;
    std::string path(entry.path);
    if ((entry.stat->st_uid != toUID || entry.stat->st_gid != GID) && lchown(path.c_str(), toUID, GID) != 0)
      QRVLogError("Could not chown {}: {}", path, errnoText(errno));
    standardizeMode(path.c_str(), *entry.stat);
    return true;
  });
  struct stat st;
  if (lstat(url.c_str(), &st) != 0) {
    int e = errno;
    return QRVFail(error, QRV_POSIX_ERROR(e, "Could not stat {}: {}", url, errnoText(e)));
  }
  if (!containsMetadataFileName(url)) {
    if (st.st_uid != toUID && lchown(url.c_str(), toUID, GID) != 0)
      QRVLogError("Could not chown {}: {}", url, errnoText(errno));
    standardizeMode(url.c_str(), st);
  }
  return ok;
}

std::optional<gid_t> QRVFileManager::_systemUsersGroup(QRVError* error) {
  std::optional<gid_t> group = accounts_ ? accounts_->groupIDForName(kSystemUsersGroupName) : std::nullopt;
  if (!group)
    QRVFail(error,
            QRV_POSIX_ERROR(ENOENT, "Failed to find the group {}: {}", kSystemUsersGroupName, errnoText(ENOENT)));
  return group;
}

bool QRVFileManager::_CreateSystemUserACEInACL(ACL* acl, uint32_t withPermissions, uint32_t andFlags, QRVError* error) {
  std::optional<gid_t> group = _systemUsersGroup(error);
  if (!group) return false;
  acl->push_back({*group, withPermissions, andFlags});
  return true;
}

std::optional<QRVFileManager::ACL> QRVFileManager::_CopySystemContainerACLWithNumACEs(int numACEs, bool isDir,
                                                                                      bool inheritOnly,
                                                                                      QRVError* error) {
  ACL acl;
  acl.reserve(static_cast<size_t>(std::max(numACEs, 1)));
  uint32_t permissions = isDir ? kSystemDirectoryRights : kSystemFileRights;
  uint32_t flags = isDir ? (kInheritToChildren | (inheritOnly ? QRVACLFlag::kOnlyInherit : 0)) : QRVACLFlag::kInherited;
  if (!_CreateSystemUserACEInACL(&acl, permissions, flags, error)) return std::nullopt;
  return acl;
}

std::optional<QRVFileManager::ACL> QRVFileManager::_CopyTopLevelSystemContainerACLWithError(QRVError* error) {
  std::optional<ACL> acl = _CopySystemContainerACLWithNumACEs(2, true, true, error);
  if (!acl || !_CreateSystemUserACEInACL(&*acl, kSystemTopLevelRights, 0, error)) return std::nullopt;
  return acl;
}

bool QRVFileManager::standardizeACLsAtURL(const std::string& url, bool isSystemContainer, QRVError* error) {
  std::optional<ACL> topLevel = _CopyTopLevelSystemContainerACLWithError(error);
  if (!topLevel) return false;
  std::optional<ACL> directory = _CopySystemContainerACLWithNumACEs(1, true, false, error);
  if (!directory) return false;
  std::optional<ACL> file = _CopySystemContainerACLWithNumACEs(1, false, false, error);
  if (!file) return false;

  return _traverseDirectory(url, error, [&](const QRVDirectoryEntry& entry, QRVError*) {
    if (entry.kind == QRVDirectoryEntry::Kind::kDirectoryPostOrder || containsMetadataFileName(entry.path)) return true;
    std::string path(entry.path);
    const bool isDirectory = S_ISDIR(entry.stat->st_mode);
    const bool isLink = S_ISLNK(entry.stat->st_mode);
    if (isDirectory && entry.level == 0 && isSystemContainer) {
      if (int e = fileSystem_->setGroupACL(path, *topLevel))
        QRVLogError("Failed to set top level ACL on dir {}: {}", path, errnoText(e));
      return true;
    }
    // Mode and owner before the ACL: on Linux a chmod rewrites the ACL mask,
    // and access to a system container is meant to be by its ACL alone.
    if (!isLink && fchmodat(AT_FDCWD, path.c_str(), 0, AT_SYMLINK_NOFOLLOW) != 0)
      QRVLogError("Could not chmod {}: {}", path, errnoText(errno));
    if (lchown(path.c_str(), kSystemContainerOwner, kSystemContainerOwner) != 0)
      QRVLogError("Could not chown {}: {}", path, errnoText(errno));
    if (!isLink) {  // links carry no ACL on Linux
      if (int e = fileSystem_->setGroupACL(path, isDirectory ? *directory : *file))
        QRVLogError("Failed to set ACL on dir {}: {}", path, errnoText(e));
    }
    return true;
  });
}

bool QRVFileManager::standardizeACLsForSystemContainerAtURL(const std::string& url, QRVError* error) {
  return standardizeACLsAtURL(url, true, error);
}

bool QRVFileManager::setTopLevelSystemContainerACLAtURL(const std::string& url, QRVError* error) {
  std::optional<ACL> topLevel = _CopyTopLevelSystemContainerACLWithError(error);
  if (!topLevel) return false;
  if (int e = fileSystem_->setGroupACL(url, *topLevel))
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to set top level ACL on dir {}: {}", url, errnoText(e)));
  return true;
}

bool QRVFileManager::standardizeAllSystemContainerACLsAtURL(const std::string& url, QRVError* error) {
  QRVError listError;
  std::optional<std::vector<std::string>> items = urlsForItemsInDirectoryAtURL(url, &listError);
  if (!items) {
    QRVLogError("Failed to get items at URL{} : {}", url, listError.description());
    return QRVFail(error, std::move(listError));
  }
  QRVLogNotice("Potential containers requiring ACL migration: ({})", fmt::join(*items, ", "));
  for (const std::string& item : *items) {
    QRVError itemError;
    if (!standardizeACLsForSystemContainerAtURL(item, &itemError))
      QRVLogError("Failed to set system container ACL at {}: {}", item, itemError.description());
  }
  return true;
}

// ---- Sizes, debugging, homes ----

uint64_t QRVFileManager::diskUsageForURL(const std::string& url) {
  if (url.empty()) {
    QRVLogError("Failed to get path to url {}", orNil(url));
    return 0;
  }
  QRVFileSystemExtras::DirectoryStatistics statistics;
  int e = fileSystem_->directoryStatistics(url, QRVFileSystemExtras::StatisticsMode::kComprehensive, &statistics);
  if (e) {
    QRVLogError("Failed to get dirstats on {} using fallback: (err {}) {}", url, e, errnoText(e));
    return 0;
  }
  if (statistics.totalSize < 0) {
    QRVLogError("Invalid size ({}) from dirstats on {} using fallback: (err {}) {}", statistics.totalSize, url, 0,
                errnoText(0));
    return 0;
  }
  QRVLogInfo("[{}]: descendants: {}, total size: {}, using fallback", url, statistics.descendants,
             statistics.totalSize);
  return static_cast<uint64_t>(statistics.totalSize);
}

uint64_t QRVFileManager::fastDiskUsageForURL(const std::string& url) {
  if (!featureFlags_ || !featureFlags_->isEnabled("quorvad", "fast_container_sizing") || url.empty())
    return diskUsageForURL(url);
  using Mode = QRVFileSystemExtras::StatisticsMode;
  QRVFileSystemExtras::DirectoryStatistics statistics;
  int e = fileSystem_->directoryStatistics(url, Mode::kFastOnly, &statistics);
  if (e == ENOTSUP) {
    if (int m = fileSystem_->enableMaintainedDirectoryStatistics(url)) {
      QRVLogError("Failed to set maintain-dir-stats on {}: (err {}) {}", url, m, errnoText(m));
    } else {
      QRVLogNotice("Enabled fast directory sizing on [{}]", url);
      e = fileSystem_->directoryStatistics(url, Mode::kFastOnly, &statistics);
    }
  }
  if (e) {
    QRVLogError("Failed to get dirstats on {}: (err {}) {}", url, e, errnoText(e));
    return diskUsageForURL(url);
  }
  if (statistics.totalSize < 0) {
    QRVLogError("Invalid size ({}) from dirstats on {}: (err {}) {}", statistics.totalSize, url, 0, errnoText(0));
    return diskUsageForURL(url);
  }
  QRVLogInfo("[{}]: descendants: {}, total size: {}", url, statistics.descendants, statistics.totalSize);
  return static_cast<uint64_t>(statistics.totalSize);
}

void QRVFileManager::printDirectoryStructureAtURL(const std::string& url) {
  QRVLogNotice("Directory structure of {}:", url);
  QRVError error;
  bool ok = _traverseDirectory(url, &error, [&](const QRVDirectoryEntry& entry, QRVError*) {
    if (entry.kind == QRVDirectoryEntry::Kind::kDirectoryPostOrder) return true;
    std::string path(entry.path);
    std::string name = entry.level == 0 ? path : lastPathComponent(path);
    const struct stat& st = *entry.stat;
    std::string suffix;
    if (S_ISDIR(st.st_mode)) {
      suffix = "/";
    } else if (S_ISLNK(st.st_mode)) {
      char target[PATH_MAX] = {};
      ssize_t n = readlink(path.c_str(), target, sizeof target - 1);
      suffix = " -> " + (n >= 0 ? std::string(target) : std::string("?"));
    }
    QRVLogNotice("{}{}{} (mode 0{:o}, owner {}:{}, size {})", std::string(2 * static_cast<size_t>(entry.level), ' '),
                 name, suffix, st.st_mode & 07777, st.st_uid, st.st_gid, st.st_size);
    return true;
  });
  if (!ok) QRVLogError("Failed to print the directory structure of {}: {}", url, error.description());
}

std::string QRVFileManager::homeDirectoryURLForPOSIXUID(uid_t uid) {
  std::optional<QRVAccount> account = accounts_ ? accounts_->accountForUID(uid) : std::nullopt;
  if (!account) {
    QRVLogError("Failed to getpwuid for uid: {}", uid);
  } else if (!account->home.empty()) {
    char buffer[PATH_MAX] = {};
    if (realpath(_underRoot(account->home).c_str(), buffer)) return buffer;
  }
  QRVLogError("Failed to get home dir using getpwuid for uid: {}", uid);
  return _underRoot("/private/var/mobile");
}

// ---- Whole files ----

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
  if (int e = syncDirectory(parentDirectory(path)))
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to flush the directory of {}: {}", path, strerror(e)));
  return true;
}

bool QRVFileManager::readRegularFileAtURL(const std::string& path, size_t maxLength, std::vector<uint8_t>* contents,
                                          QRVError* error) {
  int directory = open(parentDirectory(path).c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (directory < 0)
    return QRVFail(error, QRV_POSIX_ERROR_QUIET(errno, "Failed to open the directory of {}: {}", path, strerror(errno)));
  int fd = openItem(directory, lastPathComponent(path).c_str());
  int e = fd < 0 ? errno : 0;
  close(directory);
  if (fd < 0) return QRVFail(error, QRV_POSIX_ERROR_QUIET(e, "Failed to open {}: {}", path, strerror(e)));
  struct stat st;
  if (fstat(fd, &st) != 0) e = errno;
  else if (!S_ISREG(st.st_mode)) e = EINVAL;
  else if (static_cast<uint64_t>(st.st_size) > maxLength) e = EFBIG;
  if (e) {
    close(fd);
    return QRVFail(error, QRV_POSIX_ERROR_QUIET(e, "Refusing to read {}: {}", path, strerror(e)));
  }
  contents->clear();
  contents->reserve(static_cast<size_t>(st.st_size));
  uint8_t buf[16384];
  for (;;) {
    ssize_t n = read(fd, buf, sizeof buf);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      e = errno;
      close(fd);
      return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to read {}: {}", path, strerror(e)));
    }
    if (n == 0) break;
    // The file may grow while it is read.
    if (contents->size() + static_cast<size_t>(n) > maxLength) {
      close(fd);
      contents->clear();
      return QRVFail(error, QRV_POSIX_ERROR_QUIET(EFBIG, "Refusing to read {}: {}", path, strerror(EFBIG)));
    }
    contents->insert(contents->end(), buf, buf + n);
  }
  close(fd);
  return true;
}

bool QRVFileManager::writeFileAtURL(const std::string& path, const std::vector<uint8_t>& contents, mode_t mode,
                                    QRVError* error) {
  if (unlink(path.c_str()) != 0 && errno != ENOENT)
    return QRVFail(error, QRV_POSIX_ERROR(errno, "Failed to remove {}: {}", path, strerror(errno)));
  int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode);
  if (fd < 0) return QRVFail(error, QRV_POSIX_ERROR(errno, "Failed to create {}: {}", path, strerror(errno)));
  bool written = writeAll(fd, contents) && fchmod(fd, mode) == 0 && fsync(fd) == 0;
  int e = written ? 0 : errno;
  if (close(fd) != 0 && !e) e = errno;
  if (e) {
    unlink(path.c_str());
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to write {}: {}", path, strerror(e)));
  }
  return true;
}

bool QRVFileManager::removeFileAtURL(const std::string& path, QRVError* error) {
  if (unlink(path.c_str()) == 0 || errno == ENOENT) return true;
  return QRVFail(error, QRV_POSIX_ERROR(errno, "Failed to remove {}: {}", path, strerror(errno)));
}

// Paths supplied by clients: containment checks and resolution, existence.
#include <fcntl.h>

#include <cerrno>
#include <cstring>

#include "fs/QRVFileManager.h"
#include "fs/QRVPathComponents.h"

namespace {

using namespace QRVPathComponents;

std::string errnoText(int e) { return strerror(e); }

// A missing path as the logs show it.
std::string orNil(const std::string& s) { return s.empty() ? "(null)" : s; }

// Only this much of a link's target is looked at: longer targets are cut
// here, as they always have been.
constexpr size_t kLinkTargetLimit = 1023;

}  // namespace

bool QRVFileManager::_validateSymlink(const std::string& path, int64_t startingDepth, int64_t* endingDepth) {
  int64_t depth = startingDepth;
  for (const std::string& component : split(path)) {
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
  std::string real;
  int e = files_->realPath(url, &real);
  if (e == 0) return real;
  if (e == ENOENT && allowNonExistentPathComponents) return _realPathWhatExistsInPath(url);
  QRVLogError("Failed to realpath {} : {}", url, errnoText(e));
  return std::nullopt;
}

std::optional<std::string> QRVFileManager::_realPathWhatExistsInPath(const std::string& path) {
  std::vector<std::string> components = split(path);
  for (size_t length = components.size(); length >= 2; length--) {
    std::string prefix = join(components, 0, length);
    struct stat st;
    if (_lstat(prefix, &st) != 0) continue;
    // The longest existing prefix decides. When it does not resolve (a
    // dangling or looping link) nothing does: resolving a shorter prefix
    // would hand back that link as if it were a name yet to be created, and
    // whatever is made there would land wherever the link points.
    std::optional<std::string> real = _realPathForURL(prefix, false);
    if (!real) return std::nullopt;
    std::string rest = join(components, length, components.size());
    if (rest.empty()) return real;
    QRVLogDebug("Realpathed {} ; appending non-existing components {}", *real, rest);
    return appending(*real, rest);
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
  for (const std::string& component : split(suspiciousPath)) {
    if (component == "..") {
      QRVLogError("The suspicious path {} contains '..' paths, which are invalid", suspiciousPath);
      return std::nullopt;
    }
  }

  std::string target;
  int e = files_->readLink(AT_FDCWD, suspiciousPath, &target);
  if (e == 0) {
    if (target.size() > kLinkTargetLimit) target.resize(kLinkTargetLimit);
    if (!target.empty() && target[0] == '/') {
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
    std::string seenFromBase = appending(deletingLast(suspiciousPath.substr(basePath.size())), target);
    if (!_validateSymlink(seenFromBase, baseDepth, nullptr)) {
      QRVLogError("Rejecting {} -> {}, as it is points outside or to the base {}", suspiciousPath, seenFromBase,
                  basePath);
      return std::nullopt;
    }
  } else if (e != EINVAL && e != ENOENT) {
    QRVLogError("Readlink failed: {}", errnoText(e));
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
  std::vector<std::string> base = split(*realBase);
  std::vector<std::string> suspicious = split(*realSuspicious);
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
  int e = _lstat(url, &st);
  if (e == 0) return true;
  if (e != ENOENT) QRVLogError("Failed to determine if {} exists: {}", url, errnoText(e));
  return false;
}

bool QRVFileManager::itemDoesNotExistAtURL(const std::string& url) {
  struct stat st;
  int e = _lstat(url, &st);
  if (e == 0) return false;
  if (e == ENOENT) return true;
  QRVLogError("Failed to determine if {} exists: {}", url, errnoText(e));
  return false;
}

bool QRVFileManager::directoryExistsAtURL(const std::string& url) {
  struct stat st;
  return _lstat(url, &st) == 0 && S_ISDIR(st.st_mode);
}

// Listing, traversal, disk usage and the debugging dump of a tree.
#include <dirent.h>
#include <fcntl.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "fs/QRVFileManager.h"
#include "fs/QRVOpenDirectory.h"
#include "fs/QRVPathComponents.h"

namespace {

std::string errnoText(int e) { return strerror(e); }

// A missing path as the logs show it.
std::string orNil(const std::string& s) { return s.empty() ? "(null)" : s; }

unsigned char typeOfMode(mode_t mode) {
  return S_ISDIR(mode) ? DT_DIR : S_ISREG(mode) ? DT_REG : S_ISLNK(mode) ? DT_LNK : DT_UNKNOWN;
}

}  // namespace

// ---- Listing ----

std::optional<std::vector<std::string>> QRVFileManager::urlsForItemsInDirectoryAtURL(const std::string& url,
                                                                                     QRVError* error) {
  std::unique_ptr<QRVOpenDirectory> directory = openDirectoryAtURL(url, error);
  if (!directory) return std::nullopt;
  return urlsForItemsInDirectory(*directory, error);
}

std::unique_ptr<QRVOpenDirectory> QRVFileManager::openDirectoryAtURL(const std::string& url, QRVError* error) {
  int fd = -1;
  if (int e = _open(url, O_RDONLY | O_DIRECTORY | O_NONBLOCK | O_CLOEXEC, &fd)) {
    if (e == ENOENT) {
      QRVFail(error, QRV_POSIX_ERROR_QUIET(e, "_IterateDirectory for {} returned {}", url, errnoText(e)));
    } else {
      QRVLogError("opendir of {} failed: {}", url, errnoText(e));
      QRVFail(error, QRV_POSIX_ERROR(e, "_IterateDirectory for {} returned {}", url, errnoText(e)));
    }
    return nullptr;
  }
  return std::make_unique<QRVOpenDirectory>(files_, fd, url);
}

std::optional<std::vector<std::string>> QRVFileManager::urlsForItemsInDirectory(const QRVOpenDirectory& directory,
                                                                                QRVError* error) {
  const std::string& url = directory.url();
  std::vector<QRVFileSystem::DirectoryEntry> entries;
  if (int e = files_->readDirectory(directory.fd(), &entries)) {
    QRVFail(error, QRV_POSIX_ERROR(e, "_IterateDirectory for {} returned {}", url, errnoText(e)));
    return std::nullopt;
  }
  std::vector<std::string> urls;
  urls.reserve(entries.size());
  for (const QRVFileSystem::DirectoryEntry& entry : entries) {
    if (entry.name[0] == '.') continue;
    unsigned char type = entry.type;
    if (type == DT_UNKNOWN) {
      struct stat st;
      if (files_->status(directory.fd(), entry.name, &st, AT_SYMLINK_NOFOLLOW) != 0) continue;
      type = typeOfMode(st.st_mode);
    }
    if (type == DT_DIR || type == DT_REG || type == DT_LNK)
      urls.push_back(QRVPathComponents::appending(url, entry.name));
  }
  std::sort(urls.begin(), urls.end());
  return urls;
}

// ---- Traversal ----

struct QRVFileManager::Walk {
  const TraversalBlock& block;
  QRVError error;
  dev_t device = 0;                                // of the starting point: the walk stays on it
  std::vector<std::pair<dev_t, ino_t>> ancestors;  // the directories being walked, to spot cycles
};

bool QRVFileManager::_traverseDirectory(const std::string& url, QRVError* error, const TraversalBlock& block) {
  if (url.empty())
    return QRVFail(error, QRV_POSIX_ERROR(ENOENT, "fts_open failed for {} with error {}", url, errnoText(ENOENT)));
  struct stat st;
  if (int e = _lstat(url, &st)) return QRVFail(error, QRV_POSIX_ERROR(e, "Error for path {}: {}", url, errnoText(e)));
  Walk walk{block, QRVError(), st.st_dev, {}};
  if (_walk(&walk, url, 0, st)) return true;
  if (error) *error = std::move(walk.error);
  return false;
}

// Delivers `path` (whose own status is `st`) and, for a directory, what lies
// below it. False once the walk is over: the block said so or an entry could
// not be examined (walk->error then says why).
bool QRVFileManager::_walk(Walk* walk, const std::string& path, int level, const struct stat& st) {
  using Kind = QRVDirectoryEntry::Kind;
  auto deliver = [&](Kind kind, int errnum) {
    QRVDirectoryEntry entry{kind, path, level, &st, errnum};
    return walk->block(entry, &walk->error);
  };
  if (!S_ISDIR(st.st_mode))
    return deliver(S_ISREG(st.st_mode)   ? Kind::kRegularFile
                   : S_ISLNK(st.st_mode) ? Kind::kSymbolicLink
                                         : Kind::kOther,
                   0);
  const std::pair<dev_t, ino_t> self{st.st_dev, st.st_ino};
  if (std::find(walk->ancestors.begin(), walk->ancestors.end(), self) != walk->ancestors.end())
    return deliver(Kind::kDirectoryCycle, 0);
  if (!deliver(Kind::kDirectory, 0)) return false;
  // A mount point is visited but not entered.
  if (st.st_dev != walk->device) return deliver(Kind::kDirectoryPostOrder, 0);

  // The whole directory is read and every entry examined before the first is
  // delivered, so that what the block does to one entry cannot change which
  // entries the walk sees. The directory is opened without following a link:
  // a link put in its place since it was examined is not entered.
  int fd = -1;
  std::vector<QRVFileSystem::DirectoryEntry> names;
  int e = files_->open(AT_FDCWD, path, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0, &fd);
  if (!e) {
    e = files_->readDirectory(fd, &names);
    _close(fd);
  }
  if (e) return deliver(Kind::kUnreadableDirectory, e);
  struct Child {
    std::string path;
    struct stat st;
    int errnum;
  };
  std::vector<Child> children;
  children.reserve(names.size());
  for (const QRVFileSystem::DirectoryEntry& name : names) {
    Child child{QRVPathComponents::appending(path, name.name), {}, 0};
    child.errnum = _lstat(child.path, &child.st);
    children.push_back(std::move(child));
  }

  walk->ancestors.push_back(self);
  for (const Child& child : children) {
    if (child.errnum) {
      walk->error = QRV_POSIX_ERROR(child.errnum, "Error for path {}: {}", child.path, errnoText(child.errnum));
      return false;
    }
    if (!_walk(walk, child.path, level + 1, child.st)) return false;
  }
  walk->ancestors.pop_back();
  return deliver(Kind::kDirectoryPostOrder, 0);
}

// ---- Sizes and debugging ----

std::optional<uint64_t> QRVFileManager::diskUsageForURL(const std::string& url, QRVError* error) {
  if (url.empty()) {
    QRVFail(error, QRV_POSIX_ERROR(ENOENT, "Failed to get path to url {}", orNil(url)));
    return std::nullopt;
  }
  QRVFileSystemExtras::DirectoryStatistics statistics;
  int e = extras_->directoryStatistics(url, QRVFileSystemExtras::StatisticsMode::kComprehensive, &statistics);
  if (e) {
    QRVFail(error,
            QRV_POSIX_ERROR(e, "Failed to get dirstats on {} using fallback: (err {}) {}", url, e, errnoText(e)));
    return std::nullopt;
  }
  if (statistics.totalSize < 0) {
    QRVFail(error, QRV_POSIX_ERROR(EOVERFLOW, "Invalid size ({}) from dirstats on {} using fallback: (err {}) {}",
                                   statistics.totalSize, url, 0, errnoText(0)));
    return std::nullopt;
  }
  QRVLogInfo("[{}]: descendants: {}, total size: {}, using fallback", url, statistics.descendants,
             statistics.totalSize);
  return static_cast<uint64_t>(statistics.totalSize);
}

std::optional<uint64_t> QRVFileManager::fastDiskUsageForURL(const std::string& url, QRVError* error) {
  if (!featureFlags_ || !featureFlags_->isEnabled("quorvad", "fast_container_sizing") || url.empty())
    return diskUsageForURL(url, error);
  using Mode = QRVFileSystemExtras::StatisticsMode;
  QRVFileSystemExtras::DirectoryStatistics statistics;
  int e = extras_->directoryStatistics(url, Mode::kFastOnly, &statistics);
  if (e == ENOTSUP) {
    if (int m = extras_->enableMaintainedDirectoryStatistics(url)) {
      QRVLogError("Failed to set maintain-dir-stats on {}: (err {}) {}", url, m, errnoText(m));
    } else {
      QRVLogNotice("Enabled fast directory sizing on [{}]", url);
      e = extras_->directoryStatistics(url, Mode::kFastOnly, &statistics);
    }
  }
  // The fast source failing is no answer yet: the walk decides.
  if (e) {
    QRVLogError("Failed to get dirstats on {}: (err {}) {}", url, e, errnoText(e));
    return diskUsageForURL(url, error);
  }
  if (statistics.totalSize < 0) {
    QRVLogError("Invalid size ({}) from dirstats on {}: (err {}) {}", statistics.totalSize, url, 0, errnoText(0));
    return diskUsageForURL(url, error);
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
    std::string name = entry.level == 0 ? path : QRVPathComponents::last(path);
    const struct stat& st = *entry.stat;
    std::string suffix;
    if (S_ISDIR(st.st_mode)) {
      suffix = "/";
    } else if (S_ISLNK(st.st_mode)) {
      std::string target;
      suffix = " -> " + (files_->readLink(AT_FDCWD, path, &target) == 0 ? target : std::string("?"));
    }
    QRVLogNotice("{}{}{} (mode 0{:o}, owner {}:{}, size {})", std::string(2 * static_cast<size_t>(entry.level), ' '),
                 name, suffix, st.st_mode & 07777, st.st_uid, st.st_gid, st.st_size);
    return true;
  });
  if (!ok) QRVLogError("Failed to print the directory structure of {}: {}", url, error.description());
}

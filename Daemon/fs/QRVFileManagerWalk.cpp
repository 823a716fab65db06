// The walk that never follows links: for changing what lies inside a
// container, whose application may plant links or swap directories while the
// daemon (as root) works on it.
#include <dirent.h>
#include <fcntl.h>

#include <cerrno>
#include <cstring>

#include "fs/QRVFileManager.h"
#include "fs/QRVPathComponents.h"

namespace {

std::string errnoText(int e) { return strerror(e); }

constexpr int kDirectoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;
constexpr int kItemFlags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;

// Directory descriptors kept open on the way down; deeper ancestors are
// closed and opened again through "..", so that no tree can exhaust the
// process's descriptors.
constexpr size_t kMaxOpenDirectories = 32;

// Opening an entry that was listed failed because it is no longer what was
// listed: gone (ENOENT), a link now (ELOOP), no longer a directory
// (ENOTDIR), or a socket now (ENXIO). The application changed its own data
// under the walk.
bool vanished(int e) { return e == ENOENT || e == ELOOP || e == ENOTDIR || e == ENXIO; }

bool sameItem(const struct stat& a, const struct stat& b) { return a.st_dev == b.st_dev && a.st_ino == b.st_ino; }

QRVDirectoryEntry::Kind kindOfNonDirectory(const struct stat& st) {
  using Kind = QRVDirectoryEntry::Kind;
  return S_ISREG(st.st_mode) ? Kind::kRegularFile : S_ISLNK(st.st_mode) ? Kind::kSymbolicLink : Kind::kOther;
}

}  // namespace

struct QRVFileManager::DescriptorWalk {
  struct Frame {
    int fd = -1;  // -1 once closed to bound the open descriptors
    std::string path;
    struct stat st;
    std::vector<QRVFileSystem::DirectoryEntry> names;
    size_t next = 0;
    int errnum = 0;  // the directory could not be read
  };
  QRVFileManager& fm;
  const TraversalBlock& block;
  dev_t device = 0;
  QRVError blockError;
  std::vector<Frame> stack;

  ~DescriptorWalk() {
    for (Frame& frame : stack)
      if (frame.fd >= 0) fm._close(frame.fd);
  }
  bool deliver(QRVDirectoryEntry::Kind kind, const std::string& path, size_t level, const struct stat& st, int fd,
               int errnum) {
    QRVDirectoryEntry entry{kind, path, static_cast<int>(level), &st, errnum, fd};
    return block(entry, &blockError);
  }
  // Delivers the directory open at `fd` before its contents and makes it the
  // current one (it then owns `fd`). False when the block ended the walk.
  bool enter(int fd, const std::string& path, const struct stat& st) {
    if (!deliver(QRVDirectoryEntry::Kind::kDirectory, path, stack.size(), st, fd, 0)) {
      fm._close(fd);
      return false;
    }
    if (stack.size() >= kMaxOpenDirectories) {
      Frame& far = stack[stack.size() - kMaxOpenDirectories];
      if (far.fd >= 0) fm._close(far.fd);
      far.fd = -1;
    }
    Frame frame{fd, path, st, {}, 0, 0};
    // A mount point is visited but not entered.
    if (st.st_dev == device) frame.errnum = fm.files_->readDirectory(fd, &frame.names);
    if (frame.errnum) frame.names.clear();
    stack.push_back(std::move(frame));
    return true;
  }
  bool isAncestor(const struct stat& st) const {
    for (const Frame& frame : stack)
      if (sameItem(frame.st, st)) return true;
    return false;
  }
};

bool QRVFileManager::traverseItemAtURLWithoutFollowingLinks(const std::string& url, QRVError* error,
                                                            const TraversalBlock& block) {
  using Kind = QRVDirectoryEntry::Kind;
  struct stat st;
  if (int e = _lstat(url, &st)) {
    if (e == ENOENT) return true;
    return QRVFail(error, QRV_POSIX_ERROR(e, "Error for path {}: {}", url, errnoText(e)));
  }
  DescriptorWalk walk{*this, block, st.st_dev, QRVError(), {}};
  auto stopped = [&] {
    if (error) *error = std::move(walk.blockError);
    return false;
  };
  if (!S_ISDIR(st.st_mode) && !S_ISREG(st.st_mode))
    return walk.deliver(kindOfNonDirectory(st), url, 0, st, -1, 0) || stopped();

  int fd = -1;
  if (int e = files_->open(AT_FDCWD, url, S_ISDIR(st.st_mode) ? kDirectoryFlags : kItemFlags, 0, &fd)) {
    if (vanished(e)) return true;
    return QRVFail(error, QRV_POSIX_ERROR(e, "Error for path {}: {}", url, errnoText(e)));
  }
  if (int e = files_->statusOfFD(fd, &st)) {
    _close(fd);
    return QRVFail(error, QRV_POSIX_ERROR(e, "Error for path {}: {}", url, errnoText(e)));
  }
  walk.device = st.st_dev;
  if (!S_ISDIR(st.st_mode)) {
    bool ok = walk.deliver(kindOfNonDirectory(st), url, 0, st, S_ISREG(st.st_mode) ? fd : -1, 0);
    _close(fd);
    return ok || stopped();
  }
  if (!walk.enter(fd, url, st)) return stopped();

  while (!walk.stack.empty()) {
    DescriptorWalk::Frame& top = walk.stack.back();
    const size_t level = walk.stack.size() - 1;
    if (top.next == top.names.size()) {
      DescriptorWalk::Frame done = std::move(top);
      walk.stack.pop_back();
      bool ok = done.errnum ? walk.deliver(Kind::kUnreadableDirectory, done.path, level, done.st, done.fd, done.errnum)
                            : walk.deliver(Kind::kDirectoryPostOrder, done.path, level, done.st, done.fd, 0);
      int reopenError = 0;
      if (ok && !walk.stack.empty() && walk.stack.back().fd < 0) {
        // The parent was closed on the way down: ".." of this directory must
        // still be that very directory.
        DescriptorWalk::Frame& parent = walk.stack.back();
        int parentFD = -1;
        struct stat parentSt;
        reopenError = files_->open(done.fd, "..", kDirectoryFlags, 0, &parentFD);
        if (!reopenError) reopenError = files_->statusOfFD(parentFD, &parentSt);
        if (!reopenError && !sameItem(parentSt, parent.st)) reopenError = ESTALE;
        if (reopenError) {
          if (parentFD >= 0) _close(parentFD);
        } else {
          parent.fd = parentFD;
        }
      }
      _close(done.fd);
      if (!ok) return stopped();
      if (reopenError)
        return QRVFail(error,
                       QRV_POSIX_ERROR(reopenError, "{} moved during the walk of {}: {}",
                                       QRVPathComponents::parentDirectory(done.path), url, errnoText(reopenError)));
      continue;
    }

    const QRVFileSystem::DirectoryEntry& listed = top.names[top.next++];
    const std::string& name = listed.name;
    const std::string path = QRVPathComponents::appending(top.path, name);
    struct stat child;
    // A directory or regular file by its listing is opened straight away:
    // the status of what was opened decides below. Anything else, or an entry
    // the file system did not type, is looked at first, so that nothing but
    // a directory or a regular file is ever opened.
    bool isDirectory = listed.type == DT_DIR;
    if (!isDirectory && listed.type != DT_REG) {
      if (int e = files_->status(top.fd, name, &child, AT_SYMLINK_NOFOLLOW)) {
        if (e == ENOENT) continue;
        return QRVFail(error, QRV_POSIX_ERROR(e, "Error for path {}: {}", path, errnoText(e)));
      }
      if (!S_ISDIR(child.st_mode) && !S_ISREG(child.st_mode)) {
        if (!walk.deliver(kindOfNonDirectory(child), path, level + 1, child, -1, 0)) return stopped();
        continue;
      }
      isDirectory = S_ISDIR(child.st_mode);
    }
    int childFD = -1;
    if (int e = files_->open(top.fd, name, isDirectory ? kDirectoryFlags : kItemFlags, 0, &childFD)) {
      if (vanished(e)) continue;
      return QRVFail(error, QRV_POSIX_ERROR(e, "Error for path {}: {}", path, errnoText(e)));
    }
    // What was opened is what counts: it may have been replaced since the
    // listing, but never by a link (O_NOFOLLOW).
    if (int e = files_->statusOfFD(childFD, &child)) {
      _close(childFD);
      return QRVFail(error, QRV_POSIX_ERROR(e, "Error for path {}: {}", path, errnoText(e)));
    }
    if (S_ISDIR(child.st_mode) && walk.isAncestor(child)) {
      _close(childFD);
      if (!walk.deliver(Kind::kDirectoryCycle, path, level + 1, child, -1, ELOOP)) return stopped();
      continue;
    }
    if (!S_ISDIR(child.st_mode)) {
      bool ok =
          walk.deliver(kindOfNonDirectory(child), path, level + 1, child, S_ISREG(child.st_mode) ? childFD : -1, 0);
      _close(childFD);
      if (!ok) return stopped();
      continue;
    }
    if (!walk.enter(childFD, path, child)) return stopped();
  }
  return true;
}

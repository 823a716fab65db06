#include "platform/linux/QRVLinuxTreeStatistics.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "platform/linux/QRVDirectoryReader.h"
#include "platform/linux/QRVLinuxFileSystemExtras.h"

namespace {

constexpr int kDirectoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK;

// Only what is counted or compared: a file system may have to work for the
// fields it is not asked for (times, owners).
constexpr unsigned kStatusFields = STATX_TYPE | STATX_MODE | STATX_NLINK | STATX_INO | STATX_BLOCKS | STATX_MNT_ID;

// Large enough that a directory of a thousand entries is read in one call.
constexpr size_t kDirentBufferSize = 64 * 1024;

}  // namespace

QRVLinuxTreeStatistics::~QRVLinuxTreeStatistics() {
  for (Frame& f : frames_)
    if (f.fd >= 0) close(f.fd);
}

int QRVLinuxTreeStatistics::status(int directoryFD, const char* name, Status* status) {
  // Like fstatat, statx must not trigger an automount: an automount point
  // is another file system, left out without being mounted for nothing.
  int flags = AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT | (name[0] == '\0' ? AT_EMPTY_PATH : 0);
  struct statx stx;
  if (statx(directoryFD, name, flags, kStatusFields, &stx) != 0) return errno;
  status->id = {makedev(stx.stx_dev_major, stx.stx_dev_minor), stx.stx_ino};
  status->mode = stx.stx_mode;
  status->nlink = stx.stx_nlink;
  status->blocks = stx.stx_blocks;
  status->mount = (stx.stx_mask & STATX_MNT_ID) ? stx.stx_mnt_id : 0;
  return 0;
}

int QRVLinuxTreeStatistics::run(const std::string& path, QRVFileSystemExtras::DirectoryStatistics* statistics) {
  if (path.empty()) return ENOENT;
  int fd = open(path.c_str(), kDirectoryFlags);
  if (fd < 0) {
    int e = errno;
    // Not a directory (or a link, which is not followed): the item alone.
    if (e != ENOTDIR && e != ELOOP) return e;
    Status item;
    if ((e = status(AT_FDCWD, path.c_str(), &item))) return e;
    count(item, /*isRoot=*/true);
  } else {
    if (int e = status(fd, "", &root_)) {
      close(fd);
      return e;
    }
    direntBuffer_.resize(kDirentBufferSize);
    if (int e = push(fd, root_, /*isRoot=*/true)) return e;
    while (!frames_.empty()) {
      if (int e = step()) return e;
    }
  }
  if (result_.totalSize < 0) return EOVERFLOW;
  *statistics = result_;
  return 0;
}

void QRVLinuxTreeStatistics::count(const Status& status, bool isRoot) {
  if (!isRoot) result_.descendants++;
  if (!S_ISDIR(status.mode) && status.nlink > 1 && !linked_.insert(status.id).second) return;
  result_.totalSize += static_cast<int64_t>(status.blocks) * 512;
}

bool QRVLinuxTreeStatistics::onRootMount(const Status& status) const {
  // A mount point shows the mounted root's device, or for a bind mount of
  // the same file system at least another mount.
  return status.id.dev == root_.id.dev && status.mount == root_.mount;
}

int QRVLinuxTreeStatistics::push(int fd, const Status& status, bool isRoot) {
  // Only a bind mount can bring a directory back below itself; with the
  // mount check that cannot happen, but a kernel that cannot name mounts
  // must not send the walk round for ever.
  if (!ancestors_.insert(status.id).second) {
    close(fd);
    return ELOOP;
  }
  Frame f;
  f.fd = fd;
  f.id = status.id;
  if (int e = QRVReadDirectoryNames(fd, &direntBuffer_, &f.names)) {
    ancestors_.erase(status.id);
    close(fd);
    return e;
  }
  count(status, isRoot);
  if (openCount_ >= QRVLinuxFileSystemExtras::kMaxOpenDirectories) {
    // Frames below firstOpen_ are closed: close the shallowest open one.
    close(frames_[firstOpen_].fd);
    frames_[firstOpen_].fd = -1;
    firstOpen_++;
    openCount_--;
  }
  frames_.push_back(std::move(f));
  openCount_++;
  return 0;
}

int QRVLinuxTreeStatistics::step() {
  Frame& f = frames_.back();
  if (f.next == f.names.size()) {
    Frame done = std::move(f);
    frames_.pop_back();
    ancestors_.erase(done.id);
    int e = 0;
    if (!frames_.empty() && frames_.back().fd < 0) {
      e = reopen(frames_.back(), done.fd);
      firstOpen_ = frames_.size() - 1;
    }
    close(done.fd);
    openCount_--;
    return e;
  }
  const char* name = f.names.c_str() + f.next;
  f.next += std::strlen(name) + 1;
  Status seen;
  if (int e = status(f.fd, name, &seen)) return e == ENOENT ? 0 : e;
  if (!S_ISDIR(seen.mode)) {
    count(seen, /*isRoot=*/false);
    return 0;
  }
  return enter(name, seen);
}

int QRVLinuxTreeStatistics::enter(const char* name, const Status& seen) {
  // Not ours to count; seen from the parent, so that nothing is opened (or
  // automounted) on another file system.
  if (!onRootMount(seen)) return 0;
  const int parentFD = frames_.back().fd;
  int fd = openat(parentFD, name, kDirectoryFlags);
  if (fd < 0) {
    int e = errno;
    if (e == ENOENT) return 0;
    if (e != ENOTDIR && e != ELOOP) return e;
    // Replaced by something else since it was examined: count what is there.
    Status now;
    if ((e = status(parentFD, name, &now))) return e == ENOENT ? 0 : e;
    if (S_ISDIR(now.mode)) return ESTALE;
    count(now, /*isRoot=*/false);
    return 0;
  }
  // Counted as opened, not as seen: something mounted on `name` in between
  // must still be left out.
  Status opened;
  if (int e = status(fd, "", &opened)) {
    close(fd);
    return e;
  }
  if (!onRootMount(opened)) {
    close(fd);
    return 0;
  }
  return push(fd, opened, /*isRoot=*/false);
}

int QRVLinuxTreeStatistics::reopen(Frame& parent, int childFD) {
  int fd = openat(childFD, "..", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (fd < 0) return errno;
  Status found;
  if (status(fd, "", &found) != 0 || !(found.id == parent.id)) {
    close(fd);
    return ESTALE;
  }
  parent.fd = fd;
  openCount_++;
  return 0;
}

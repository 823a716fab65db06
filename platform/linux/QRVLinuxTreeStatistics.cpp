#include "platform/linux/QRVLinuxTreeStatistics.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

#include "platform/linux/QRVDirectoryReader.h"
#include "platform/linux/QRVLinuxFileSystemExtras.h"

namespace {

// The names in the open directory `fd`; `fd` stays usable for openat and
// fstatat.
int readNames(int fd, std::vector<std::string>* names) {
  return QRVForEachDirectoryEntry(fd, [&](const dirent& entry) {
    names->emplace_back(entry.d_name);
    return 0;
  });
}

constexpr int kDirectoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK;

}  // namespace

QRVLinuxTreeStatistics::~QRVLinuxTreeStatistics() {
  for (Frame& f : frames_)
    if (f.fd >= 0) close(f.fd);
}

uint64_t QRVLinuxTreeStatistics::mountOf(int fd) {
  struct statx stx;
  if (statx(fd, "", AT_EMPTY_PATH | AT_SYMLINK_NOFOLLOW, STATX_MNT_ID, &stx) != 0) return 0;
  return (stx.stx_mask & STATX_MNT_ID) ? stx.stx_mnt_id : 0;
}

int QRVLinuxTreeStatistics::run(const std::string& path, QRVFileSystemExtras::DirectoryStatistics* statistics) {
  if (path.empty()) return ENOENT;
  int fd = open(path.c_str(), kDirectoryFlags);
  if (fd < 0) {
    int e = errno;
    // Not a directory (or a link, which is not followed): the item alone.
    if (e != ENOTDIR && e != ELOOP) return e;
    struct stat st;
    if (lstat(path.c_str(), &st) != 0) return errno;
    count(st, /*isRoot=*/true);
  } else {
    struct stat st;
    if (fstat(fd, &st) != 0) {
      int e = errno;
      close(fd);
      return e;
    }
    rootDevice_ = st.st_dev;
    rootMount_ = mountOf(fd);
    if (int e = push(fd, st, /*isRoot=*/true)) return e;
    while (!frames_.empty()) {
      if (int e = step()) return e;
    }
  }
  if (result_.totalSize < 0) return EOVERFLOW;
  *statistics = result_;
  return 0;
}

void QRVLinuxTreeStatistics::count(const struct stat& st, bool isRoot) {
  if (!isRoot) result_.descendants++;
  if (!S_ISDIR(st.st_mode) && st.st_nlink > 1 && !linked_.insert({st.st_dev, st.st_ino}).second) return;
  result_.totalSize += static_cast<int64_t>(st.st_blocks) * 512;
}

int QRVLinuxTreeStatistics::push(int fd, const struct stat& st, bool isRoot) {
  // Only a bind mount can bring a directory back below itself; with the
  // mount check that cannot happen, but a kernel that cannot name mounts
  // must not send the walk round for ever.
  if (!ancestors_.insert({st.st_dev, st.st_ino}).second) {
    close(fd);
    return ELOOP;
  }
  Frame f;
  f.fd = fd;
  f.dev = st.st_dev;
  f.ino = st.st_ino;
  if (int e = readNames(fd, &f.pending)) {
    ancestors_.erase({st.st_dev, st.st_ino});
    close(fd);
    return e;
  }
  count(st, isRoot);
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
  if (f.pending.empty()) {
    Frame done = std::move(f);
    frames_.pop_back();
    ancestors_.erase({done.dev, done.ino});
    int e = 0;
    if (!frames_.empty() && frames_.back().fd < 0) {
      e = reopen(frames_.back(), done.fd);
      firstOpen_ = frames_.size() - 1;
    }
    close(done.fd);
    openCount_--;
    return e;
  }
  const std::string name = std::move(f.pending.back());
  f.pending.pop_back();
  struct stat st;
  if (fstatat(f.fd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) return errno == ENOENT ? 0 : errno;
  if (!S_ISDIR(st.st_mode)) {
    count(st, /*isRoot=*/false);
    return 0;
  }
  // A mount point shows the mounted root's device: not ours to count.
  if (st.st_dev != rootDevice_) return 0;
  int fd = openat(f.fd, name.c_str(), kDirectoryFlags);
  if (fd < 0) {
    int e = errno;
    if (e == ENOENT) return 0;
    if (e != ENOTDIR && e != ELOOP) return e;
    // Replaced by something else since it was examined: count what is there.
    if (fstatat(f.fd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) return errno == ENOENT ? 0 : errno;
    if (S_ISDIR(st.st_mode)) return ESTALE;
    count(st, /*isRoot=*/false);
    return 0;
  }
  if (fstat(fd, &st) != 0) {
    int e = errno;
    close(fd);
    return e;
  }
  const uint64_t mount = rootMount_ ? mountOf(fd) : 0;
  if (st.st_dev != rootDevice_ || mount != rootMount_) {
    close(fd);
    return 0;
  }
  return push(fd, st, /*isRoot=*/false);
}

int QRVLinuxTreeStatistics::reopen(Frame& parent, int childFD) {
  int fd = openat(childFD, "..", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (fd < 0) return errno;
  struct stat st;
  if (fstat(fd, &st) != 0 || st.st_dev != parent.dev || st.st_ino != parent.ino) {
    close(fd);
    return ESTALE;
  }
  parent.fd = fd;
  openCount_++;
  return 0;
}

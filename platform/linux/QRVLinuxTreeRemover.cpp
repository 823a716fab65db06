#include "platform/linux/QRVLinuxTreeRemover.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

#include "platform/linux/QRVLinuxFileSystemExtras.h"

QRVLinuxTreeRemover::QRVLinuxTreeRemover(QRVFileSystemExtras::RemovalErrorHandler onError, std::string topPath)
    : onError_(std::move(onError)), topPath_(std::move(topPath)) {}

QRVLinuxTreeRemover::~QRVLinuxTreeRemover() {
  for (Frame& f : frames_)
    if (f.dir) closedir(f.dir);
}

int QRVLinuxTreeRemover::run(int parentFD, const std::string& name) {
  struct stat st;
  if (fstatat(parentFD, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  if (!S_ISDIR(st.st_mode)) {
    if (unlinkat(parentFD, name.c_str(), 0) != 0) report(parentFD, name, topPath_, errno, false);
    return 0;
  }
  topParentFD_ = parentFD;
  int fd = openat(parentFD, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK);
  DIR* dir = fd >= 0 ? fdopendir(fd) : nullptr;
  if (!dir) {
    int e = errno;
    if (fd >= 0) close(fd);
    if (unlinkat(parentFD, name.c_str(), AT_REMOVEDIR) != 0) report(parentFD, name, topPath_, e, false);
    return 0;
  }
  push(dir, st, name);
  while (!frames_.empty()) {
    if (int e = step()) return e;
  }
  return 0;
}

void QRVLinuxTreeRemover::push(DIR* dir, const struct stat& st, std::string name) {
  if (openCount_ >= QRVLinuxFileSystemExtras::kMaxOpenDirectories) {
    for (Frame& f : frames_) {
      if (f.dir) {
        closedir(f.dir);
        f.dir = nullptr;
        openCount_--;
        break;
      }
    }
  }
  Frame f;
  f.dir = dir;
  f.dev = st.st_dev;
  f.ino = st.st_ino;
  f.name = std::move(name);
  frames_.push_back(std::move(f));
  openCount_++;
}

std::string QRVLinuxTreeRemover::pathInCurrentFrame(const std::string& name) const {
  std::string path = topPath_;
  for (size_t i = 1; i < frames_.size(); i++) path += "/" + frames_[i].name;
  return path + "/" + name;
}

bool QRVLinuxTreeRemover::report(int directoryFD, const std::string& name, const std::string& path, int errnum,
                                 bool inTree) {
  if (!onError_) return false;
  QRVFileSystemExtras::RemovalFailure failure{directoryFD, name.c_str(), path, errnum, inTree};
  return onError_(failure);
}

void QRVLinuxTreeRemover::failed(int directoryFD, const std::string& name, int errnum) {
  Frame& f = frames_.back();
  if (report(directoryFD, name, pathInCurrentFrame(name), errnum, true))
    f.progress = true;
  else
    f.kept.insert(name);
}

int QRVLinuxTreeRemover::step() {
  Frame& f = frames_.back();
  int fd = dirfd(f.dir);
  errno = 0;
  dirent* entry = readdir(f.dir);
  if (!entry) {
    // Entries removed during a pass may hide others on some file systems:
    // read again until a pass removes nothing.
    if (errno == 0 && f.progress && f.passes < kMaxPasses) {
      f.progress = false;
      f.passes++;
      rewinddir(f.dir);
      return 0;
    }
    return finishFrame();
  }
  std::string name = entry->d_name;
  if (name == "." || name == ".." || f.kept.count(name)) return 0;
  bool isDirectory = entry->d_type == DT_DIR;
  if (entry->d_type == DT_UNKNOWN) {
    struct stat st;
    if (fstatat(fd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) {
      if (errno != ENOENT) failed(fd, name, errno);
      return 0;
    }
    isDirectory = S_ISDIR(st.st_mode);
  }
  if (!isDirectory) {
    if (unlinkat(fd, name.c_str(), 0) == 0 || errno == ENOENT) {
      f.progress = true;
      return 0;
    }
    if (errno != EISDIR) {
      failed(fd, name, errno);
      return 0;
    }
  }
  int childFD = openat(fd, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK);
  if (childFD < 0) {
    int e = errno;
    if (e == ENOENT) return 0;
    // Not enterable (or no longer a directory): remove it as it is.
    int flags = (e == ENOTDIR || e == ELOOP) ? 0 : AT_REMOVEDIR;
    if (unlinkat(fd, name.c_str(), flags) == 0)
      f.progress = true;
    else
      failed(fd, name, e);
    return 0;
  }
  struct stat st;
  if (fstat(childFD, &st) != 0 || st.st_dev != f.dev) {
    // Another file system is mounted here: never descend into it. Removing
    // the mount point fails (EBUSY), and that is reported.
    close(childFD);
    if (unlinkat(fd, name.c_str(), AT_REMOVEDIR) == 0)
      f.progress = true;
    else
      failed(fd, name, errno);
    return 0;
  }
  DIR* child = fdopendir(childFD);
  if (!child) {
    int e = errno;
    close(childFD);
    failed(fd, name, e);
    return 0;
  }
  push(child, st, std::move(name));
  return 0;
}

int QRVLinuxTreeRemover::finishFrame() {
  Frame done = std::move(frames_.back());
  frames_.pop_back();
  int parentFD = topParentFD_;
  if (!frames_.empty()) {
    Frame& parent = frames_.back();
    if (!parent.dir) {
      int e = reopen(parent, dirfd(done.dir));
      if (e) {
        closedir(done.dir);
        openCount_--;
        return e;
      }
    }
    parentFD = dirfd(parent.dir);
  }
  closedir(done.dir);
  openCount_--;
  if (unlinkat(parentFD, done.name.c_str(), AT_REMOVEDIR) == 0 || errno == ENOENT) {
    if (!frames_.empty()) frames_.back().progress = true;
    return 0;
  }
  int e = errno;
  if (frames_.empty()) {
    report(parentFD, done.name, topPath_, e, false);
  } else {
    failed(parentFD, done.name, e);
  }
  return 0;
}

int QRVLinuxTreeRemover::reopen(Frame& parent, int childFD) {
  int fd = openat(childFD, "..", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (fd < 0) return errno;
  struct stat st;
  if (fstat(fd, &st) != 0 || st.st_dev != parent.dev || st.st_ino != parent.ino) {
    close(fd);
    return ESTALE;
  }
  parent.dir = fdopendir(fd);
  if (!parent.dir) {
    int e = errno;
    close(fd);
    return e;
  }
  openCount_++;
  return 0;
}

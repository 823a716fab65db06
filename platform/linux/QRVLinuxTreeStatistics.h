// The walk behind QRVLinuxFileSystemExtras::directoryStatistics: allocated
// bytes (st_blocks * 512) and the number of entries of a tree, the way `du`
// counts them. It is descriptor-relative (openat/fstatat), so neither links
// nor the length of paths matter: an application can nest directories far
// deeper than PATH_MAX inside its container, and its usage must still be
// measured, not cut short.
//
// - Links are never followed; a link counts with its own blocks.
// - A file with several names is counted once.
// - Another file system (including a bind mount of the same one) is neither
//   entered nor counted: its bytes are not this tree's.
// - At most QRVLinuxFileSystemExtras::kMaxOpenDirectories directories stay
//   open; a shallower one is found again through ".." of its child and must
//   still be the directory the walk left (ESTALE otherwise).
// - The depth is bounded by memory only: the walk keeps its own stack.
// - An entry that vanishes while the walk runs is not counted; any other
//   failure ends the walk with its errno. There is no partial answer.
//
// One walker serves one measurement, on one thread.
#pragma once

#include <sys/stat.h>

#include <cstdint>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/QRVFileSystemExtras.h"

class QRVLinuxTreeStatistics {
 public:
  QRVLinuxTreeStatistics() = default;
  ~QRVLinuxTreeStatistics();
  QRVLinuxTreeStatistics(const QRVLinuxTreeStatistics&) = delete;
  QRVLinuxTreeStatistics& operator=(const QRVLinuxTreeStatistics&) = delete;

  // Measures the item at `path` (not followed when it is a link) and, when it
  // is a directory, everything below it. 0 or the errno that ended the walk.
  int run(const std::string& path, QRVFileSystemExtras::DirectoryStatistics* statistics);

 private:
  struct Frame {
    int fd = -1;  // -1 while closed to save descriptors
    dev_t dev = 0;
    ino_t ino = 0;
    std::vector<std::string> pending;  // entries not yet measured, last first
  };

  // Counts one entry with status `st`; the starting point is no descendant.
  void count(const struct stat& st, bool isRoot);
  // Reads the names of the open directory `fd` (status `st`), counts it and
  // makes it the innermost frame. Takes `fd` over in every case.
  int push(int fd, const struct stat& st, bool isRoot);
  // Measures the next entry of the innermost frame, or leaves the frame.
  int step();
  // Re-finds the closed `parent` as ".." of the open directory `childFD`.
  int reopen(Frame& parent, int childFD);
  // The mount the open directory `fd` is on, or 0 when the kernel cannot say.
  static uint64_t mountOf(int fd);

  std::vector<Frame> frames_;
  size_t openCount_ = 0;
  size_t firstOpen_ = 0;  // frames below this index are closed, the rest open
  dev_t rootDevice_ = 0;
  uint64_t rootMount_ = 0;
  std::set<std::pair<dev_t, ino_t>> ancestors_;  // the directories of frames_
  std::set<std::pair<dev_t, ino_t>> linked_;     // files with several names already counted
  QRVFileSystemExtras::DirectoryStatistics result_;
};

// The walk behind QRVLinuxFileSystemExtras::directoryStatistics: allocated
// bytes (st_blocks * 512) and the number of entries of a tree, the way `du`
// counts them. It is descriptor-relative (openat/statx), so neither links
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
// It costs what `du` costs: one statx per entry, from its parent, asking
// only for the fields counted; and per directory one open, one statx of
// the open directory (what is counted is what was opened, so a directory
// swapped for a mount point between the two calls is still left out),
// getdents64 reads into one large buffer and one close. Each directory's
// names are kept in one string.
//
// One walker serves one measurement, on one thread.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string>
#include <unordered_set>
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
  // Which file an entry is: its device and inode.
  struct Identity {
    dev_t dev = 0;
    ino_t ino = 0;
    bool operator==(const Identity&) const = default;
  };
  struct IdentityHash {
    size_t operator()(const Identity& id) const { return id.ino ^ (static_cast<size_t>(id.dev) << 40); }
  };
  // What the walk needs to know of an entry.
  struct Status {
    Identity id;
    mode_t mode = 0;
    uint32_t nlink = 0;
    uint64_t blocks = 0;
    uint64_t mount = 0;  // 0 when the kernel cannot say
  };
  struct Frame {
    int fd = -1;  // -1 while closed to save descriptors
    Identity id;
    std::string names;  // the entries, each ended by '\0'
    size_t next = 0;    // offset in `names` of the next entry to measure
  };

  // The status of `name` in the directory `directoryFD` ("" for the
  // directory itself), links not followed. 0 or the errno of statx.
  static int status(int directoryFD, const char* name, Status* status);
  // Counts one entry; the starting point is no descendant.
  void count(const Status& status, bool isRoot);
  // Reads the names of the open directory `fd` (status `status`), counts it
  // and makes it the innermost frame. Takes `fd` over in every case.
  int push(int fd, const Status& status, bool isRoot);
  // Measures the next entry of the innermost frame, or leaves the frame.
  int step();
  // Measures the directory `name` of the innermost frame, seen as `seen`.
  int enter(const char* name, const Status& seen);
  // Re-finds the closed `parent` as ".." of the open directory `childFD`.
  int reopen(Frame& parent, int childFD);
  // Whether a directory with status `status` lies on the starting point's mount.
  bool onRootMount(const Status& status) const;

  std::vector<Frame> frames_;
  size_t openCount_ = 0;
  size_t firstOpen_ = 0;  // frames below this index are closed, the rest open
  Status root_;
  std::vector<char> direntBuffer_;
  std::unordered_set<Identity, IdentityHash> ancestors_;  // the directories of frames_
  std::unordered_set<Identity, IdentityHash> linked_;     // files with several names already counted
  QRVFileSystemExtras::DirectoryStatistics result_;
};

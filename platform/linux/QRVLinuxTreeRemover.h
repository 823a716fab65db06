// The recursive removal of QRVLinuxFileSystemExtras::removeTree: a
// descriptor-relative walk (openat/unlinkat), so that neither links nor the
// length of paths matter. It keeps at most
// QRVLinuxFileSystemExtras::kMaxOpenDirectories directories open and re-finds
// shallower ones through "..", checking that each is still the directory it
// left (ESTALE otherwise). It never enters another file system: removing a
// mount point fails, and that failure is reported.
//
// Each entry that cannot be removed goes to the error handler (when set),
// which may deal with it; the walk goes on with the rest, and a directory is
// read again (up to kMaxPasses times) while a pass still removes something.
//
// One remover serves one removal, on one thread.
#pragma once

#include <dirent.h>
#include <sys/stat.h>

#include <string>
#include <unordered_set>
#include <vector>

#include "platform/QRVFileSystemExtras.h"

class QRVLinuxTreeRemover {
 public:
  // `topPath` names what is removed, for the handler's messages.
  QRVLinuxTreeRemover(QRVFileSystemExtras::RemovalErrorHandler onError, std::string topPath);
  ~QRVLinuxTreeRemover();
  QRVLinuxTreeRemover(const QRVLinuxTreeRemover&) = delete;
  QRVLinuxTreeRemover& operator=(const QRVLinuxTreeRemover&) = delete;

  // Removes the entry `name` of the open directory `parentFD` and, when it is
  // a directory, everything below it. Returns the errno when the entry cannot
  // be examined or the tree changed shape beneath the walk, and 0 otherwise
  // (failures of single entries are the handler's).
  int run(int parentFD, const std::string& name);

 private:
  static constexpr int kMaxPasses = 4;

  struct Frame {
    DIR* dir = nullptr;  // null while closed to save descriptors
    dev_t dev = 0;
    ino_t ino = 0;
    std::string name;
    std::unordered_set<std::string> kept;  // entries that could not be removed
    bool progress = false;                 // something was removed in this pass
    int passes = 0;
  };

  void push(DIR* dir, const struct stat& st, std::string name);

  // The path of `name` inside the innermost frame, for messages.
  std::string pathInCurrentFrame(const std::string& name) const;

  bool report(int directoryFD, const std::string& name, const std::string& path, int errnum, bool inTree);

  // Records the outcome of a failed removal of `name` in the current frame.
  void failed(int directoryFD, const std::string& name, int errnum);

  int step();

  // The current frame is empty (or holds only what could not be removed):
  // remove it from its parent.
  int finishFrame();

  // Re-finds `parent` as ".." of its child, refusing a directory that is not
  // the one the walk came from (the tree was moved beneath us).
  int reopen(Frame& parent, int childFD);

  const QRVFileSystemExtras::RemovalErrorHandler onError_;
  const std::string topPath_;
  int topParentFD_ = -1;
  std::vector<Frame> frames_;
  size_t openCount_ = 0;
};

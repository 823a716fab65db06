// A forwarding wrapper around a real QRVFileSystem for tests: every call goes
// to the wrapped implementation unless the test asked for something else.
//
// - inject(op, fault) makes calls of kind `op` fail with fault.errnum without
//   reaching the wrapped implementation: the fault.nth-th matching call from
//   now and the fault.times - 1 matching calls after it (kForever: all of
//   them). A call matches when fault.pathContains is empty or occurs in the
//   path it names (either path of a rename; for a call on a descriptor, the
//   path that descriptor was opened with through this wrapper). failNext() is
//   the common case: the next matching call fails once.
// - setHook(op, hook) runs `hook(path)` at every call of kind `op`, before
//   it goes on, without the wrapper's lock: a test can make one call wait
//   on a latch to hold an operation halfway while it looks at the others.
// - calls(op) counts the calls of a kind that reached the wrapper, failed
//   ones included.
// - setRecordOwnership(true) turns ownership changes into bookkeeping, so
//   that tests need not run as root: changeOwner/changeOwnerOfFD look the
//   item up (following links only when the call would), store
//   (device, inode) -> (uid, gid) and succeed; status/statusOfFD then report
//   the recorded owner. Nothing else is checked: every caller acts as root.
//   A record lives as long as the wrapper, not as long as the inode, so a
//   test must not count on a removed item's inode number being free.
//
// Thread-safe: the daemon's queues call it from several threads.
#pragma once

#include <fcntl.h>

#include <cerrno>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "platform/QRVFileSystem.h"

class QRVFaultInjectionFileSystem : public QRVFileSystem {
 public:
  enum class Operation {
    kOpen,
    kOpenResolved,
    kClose,
    kMakeDirectory,
    kMakeTemporaryDirectory,
    kMakeTemporaryFile,
    kRename,
    kUnlink,
    kChangeOwner,  // both forms
    kChangeMode,   // both forms
    kStatus,       // both forms
    kSynchronize,  // fsync
    kSynchronizeFileSystem,
    kReadLink,
    kRealPath,
    kReadDirectory,
    kRead,
    kWrite,
  };
  static constexpr int kForever = -1;
  struct Fault {
    int errnum = EIO;
    int nth = 1;
    int times = 1;
    std::string pathContains;
  };

  explicit QRVFaultInjectionFileSystem(std::shared_ptr<QRVFileSystem> target) : target_(std::move(target)) {}

  void inject(Operation op, Fault fault) {
    std::lock_guard<std::mutex> l(m_);
    faults_.push_back({op, std::move(fault)});
  }
  void failNext(Operation op, int errnum, const std::string& pathContains = "") {
    inject(op, {errnum, 1, 1, pathContains});
  }
  // Forgets every fault not yet used up.
  void clearFaults() {
    std::lock_guard<std::mutex> l(m_);
    faults_.clear();
  }
  using Hook = std::function<void(const std::string& path)>;
  // An empty hook removes the one of that kind.
  void setHook(Operation op, Hook hook) {
    std::lock_guard<std::mutex> l(m_);
    if (hook)
      hooks_[op] = std::make_shared<const Hook>(std::move(hook));
    else
      hooks_.erase(op);
  }
  int calls(Operation op) {
    std::lock_guard<std::mutex> l(m_);
    return calls_[op];
  }
  void setRecordOwnership(bool record) {
    std::lock_guard<std::mutex> l(m_);
    recordOwnership_ = record;
  }
  bool recordsOwnership() {
    std::lock_guard<std::mutex> l(m_);
    return recordOwnership_;
  }
  // Every operation from now on, in order, with the path it names (a
  // descriptor's is the path it was opened with), for tests of the order in
  // which durable steps happen.
  struct TracedCall {
    Operation op;
    std::string path, otherPath;
  };
  void startTracing() {
    std::lock_guard<std::mutex> l(m_);
    tracing_ = true;
    trace_.clear();
  }
  std::vector<TracedCall> trace() {
    std::lock_guard<std::mutex> l(m_);
    return trace_;
  }

  int open(int directoryFD, const std::string& path, int flags, mode_t mode, int* fd) override {
    if (int e = enter(Operation::kOpen, path)) return e;
    int e = target_->open(directoryFD, path, flags, mode, fd);
    if (!e) remember(*fd, path);
    return e;
  }
  int openResolved(int directoryFD, const std::string& path, int flags, uint64_t resolve, int* fd) override {
    if (int e = enter(Operation::kOpenResolved, path)) return e;
    int e = target_->openResolved(directoryFD, path, flags, resolve, fd);
    if (!e) remember(*fd, path);
    return e;
  }
  int close(int fd) override {
    std::string path = pathOf(fd);
    forget(fd);
    if (int e = enter(Operation::kClose, path)) {
      target_->close(fd);  // a close that fails still releases the descriptor
      return e;
    }
    return target_->close(fd);
  }
  int makeDirectory(int directoryFD, const std::string& path, mode_t mode) override {
    if (int e = enter(Operation::kMakeDirectory, path)) return e;
    return target_->makeDirectory(directoryFD, path, mode);
  }
  int makeTemporaryDirectory(std::string* pathTemplate) override {
    if (int e = enter(Operation::kMakeTemporaryDirectory, *pathTemplate)) return e;
    return target_->makeTemporaryDirectory(pathTemplate);
  }
  int makeTemporaryFile(std::string* pathTemplate, int flags, int* fd) override {
    if (int e = enter(Operation::kMakeTemporaryFile, *pathTemplate)) return e;
    int e = target_->makeTemporaryFile(pathTemplate, flags, fd);
    if (!e) remember(*fd, *pathTemplate);
    return e;
  }
  int rename(int fromDirectoryFD, const std::string& from, int toDirectoryFD, const std::string& to,
             unsigned flags) override {
    if (int e = enter(Operation::kRename, from, to)) return e;
    return target_->rename(fromDirectoryFD, from, toDirectoryFD, to, flags);
  }
  int unlink(int directoryFD, const std::string& path, int flags) override {
    if (int e = enter(Operation::kUnlink, path)) return e;
    return target_->unlink(directoryFD, path, flags);
  }
  int changeOwner(int directoryFD, const std::string& path, uid_t uid, gid_t gid, int flags) override {
    if (int e = enter(Operation::kChangeOwner, path)) return e;
    if (!recordsOwnership()) return target_->changeOwner(directoryFD, path, uid, gid, flags);
    struct stat st;
    if (int e = target_->status(directoryFD, path, &st, flags & (AT_SYMLINK_NOFOLLOW | AT_EMPTY_PATH))) return e;
    record(st, uid, gid);
    return 0;
  }
  int changeOwnerOfFD(int fd, uid_t uid, gid_t gid) override {
    if (int e = enter(Operation::kChangeOwner, pathOf(fd))) return e;
    if (!recordsOwnership()) return target_->changeOwnerOfFD(fd, uid, gid);
    struct stat st;
    if (int e = target_->statusOfFD(fd, &st)) return e;
    record(st, uid, gid);
    return 0;
  }
  int changeMode(int directoryFD, const std::string& path, mode_t mode, int flags) override {
    if (int e = enter(Operation::kChangeMode, path)) return e;
    return target_->changeMode(directoryFD, path, mode, flags);
  }
  int changeModeOfFD(int fd, mode_t mode) override {
    if (int e = enter(Operation::kChangeMode, pathOf(fd))) return e;
    return target_->changeModeOfFD(fd, mode);
  }
  int status(int directoryFD, const std::string& path, struct stat* st, int flags) override {
    if (int e = enter(Operation::kStatus, path)) return e;
    int e = target_->status(directoryFD, path, st, flags);
    if (!e) applyRecordedOwner(st);
    return e;
  }
  int statusOfFD(int fd, struct stat* st) override {
    if (int e = enter(Operation::kStatus, pathOf(fd))) return e;
    int e = target_->statusOfFD(fd, st);
    if (!e) applyRecordedOwner(st);
    return e;
  }
  int synchronize(int fd) override {
    if (int e = enter(Operation::kSynchronize, pathOf(fd))) return e;
    return target_->synchronize(fd);
  }
  int synchronizeFileSystem(int fd) override {
    if (int e = enter(Operation::kSynchronizeFileSystem, pathOf(fd))) return e;
    return target_->synchronizeFileSystem(fd);
  }
  int readLink(int directoryFD, const std::string& path, std::string* target) override {
    if (int e = enter(Operation::kReadLink, path)) return e;
    return target_->readLink(directoryFD, path, target);
  }
  int realPath(const std::string& path, std::string* resolved) override {
    if (int e = enter(Operation::kRealPath, path)) return e;
    return target_->realPath(path, resolved);
  }
  int readDirectory(int fd, std::vector<DirectoryEntry>* entries) override {
    if (int e = enter(Operation::kReadDirectory, pathOf(fd))) return e;
    return target_->readDirectory(fd, entries);
  }
  int read(int fd, void* buffer, size_t size, size_t* done) override {
    if (int e = enter(Operation::kRead, pathOf(fd))) return e;
    return target_->read(fd, buffer, size, done);
  }
  int write(int fd, const void* buffer, size_t size, size_t* done) override {
    if (int e = enter(Operation::kWrite, pathOf(fd))) return e;
    return target_->write(fd, buffer, size, done);
  }

 private:
  struct PendingFault {
    Operation op;
    Fault fault;
  };

  // Runs the hook of `op`, then counts the call and returns the injected
  // failure, if one is due.
  int enter(Operation op, const std::string& path, const std::string& otherPath = "") {
    if (std::shared_ptr<const Hook> hook = hookFor(op)) (*hook)(path);
    std::lock_guard<std::mutex> l(m_);
    calls_[op]++;
    if (tracing_) trace_.push_back({op, path, otherPath});
    for (auto it = faults_.begin(); it != faults_.end(); ++it) {
      Fault& f = it->fault;
      if (it->op != op) continue;
      if (!f.pathContains.empty() && path.find(f.pathContains) == std::string::npos &&
          otherPath.find(f.pathContains) == std::string::npos)
        continue;
      if (--f.nth > 0) continue;
      int e = f.errnum;
      if (f.times != kForever && --f.times <= 0) faults_.erase(it);
      return e;
    }
    return 0;
  }
  std::shared_ptr<const Hook> hookFor(Operation op) {
    std::lock_guard<std::mutex> l(m_);
    auto it = hooks_.find(op);
    return it == hooks_.end() ? nullptr : it->second;
  }
  void remember(int fd, const std::string& path) {
    std::lock_guard<std::mutex> l(m_);
    paths_[fd] = path;
  }
  void forget(int fd) {
    std::lock_guard<std::mutex> l(m_);
    paths_.erase(fd);
  }
  std::string pathOf(int fd) {
    std::lock_guard<std::mutex> l(m_);
    auto it = paths_.find(fd);
    return it == paths_.end() ? std::string() : it->second;
  }
  void record(const struct stat& st, uid_t uid, gid_t gid) {
    std::lock_guard<std::mutex> l(m_);
    auto key = std::make_pair(st.st_dev, st.st_ino);
    auto it = owners_.find(key);
    std::pair<uid_t, gid_t> owner = it == owners_.end() ? std::make_pair(st.st_uid, st.st_gid) : it->second;
    if (uid != static_cast<uid_t>(-1)) owner.first = uid;
    if (gid != static_cast<gid_t>(-1)) owner.second = gid;
    owners_[key] = owner;
  }
  void applyRecordedOwner(struct stat* st) {
    std::lock_guard<std::mutex> l(m_);
    auto it = owners_.find({st->st_dev, st->st_ino});
    if (it == owners_.end()) return;
    st->st_uid = it->second.first;
    st->st_gid = it->second.second;
  }

  const std::shared_ptr<QRVFileSystem> target_;
  std::mutex m_;
  std::vector<PendingFault> faults_;
  std::map<Operation, int> calls_;
  std::map<Operation, std::shared_ptr<const Hook>> hooks_;
  std::map<int, std::string> paths_;  // open descriptors -> the path they were opened with
  bool recordOwnership_ = false;
  bool tracing_ = false;
  std::vector<TracedCall> trace_;
  std::map<std::pair<dev_t, ino_t>, std::pair<uid_t, gid_t>> owners_;
};

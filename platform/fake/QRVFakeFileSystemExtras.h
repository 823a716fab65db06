// A forwarding wrapper around a real QRVFileSystemExtras for tests: every call
// goes to the wrapped implementation unless the test asked for something else.
//
// - failNext(op, errno, n) makes the next n calls of `op` fail with errno
//   without reaching the wrapped implementation;
// - inMemoryProtectionClasses keeps classes in a table keyed by device and
//   inode instead of extended attributes (which need root), honouring the lock
//   state the way the real one does (EPERM while locked);
// - statisticsOverride answers directory statistics of one mode with fixed
//   values;
// - calls(op) counts the calls that reached the wrapper, and statisticsModes
//   lists the modes asked for, in order.
#pragma once

#include <sys/stat.h>

#include <cerrno>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <utility>
#include <vector>

#include "platform/QRVFileSystemExtras.h"
#include "platform/QRVLockStateService.h"

class QRVFakeFileSystemExtras : public QRVFileSystemExtras {
 public:
  enum class Operation {
    kProtectionClass,
    kSetProtectionClass,
    kImmutableFlag,
    kSetImmutableFlag,
    kSetGroupACL,
    kCopyItem,
    kRemoveTree,
    kDirectoryStatistics,
    kEnableMaintainedDirectoryStatistics,
  };

  QRVFakeFileSystemExtras(std::shared_ptr<QRVFileSystemExtras> target, std::shared_ptr<QRVLockStateService> lockState)
      : target_(std::move(target)), lockState_(std::move(lockState)) {}

  void failNext(Operation op, int errnum, int count = 1) {
    std::lock_guard<std::mutex> l(m_);
    failures_[op] = {errnum, count};
  }
  int calls(Operation op) {
    std::lock_guard<std::mutex> l(m_);
    return calls_[op];
  }
  std::vector<StatisticsMode> statisticsModes() {
    std::lock_guard<std::mutex> l(m_);
    return statisticsModes_;
  }
  void setInMemoryProtectionClasses(bool inMemory) {
    std::lock_guard<std::mutex> l(m_);
    inMemoryClasses_ = inMemory;
  }
  void setStatisticsOverride(StatisticsMode mode, DirectoryStatistics statistics) {
    std::lock_guard<std::mutex> l(m_);
    statisticsOverride_[mode] = statistics;
  }

  int protectionClass(int fd, uint32_t* protectionClass) override {
    if (int e = enter(Operation::kProtectionClass)) return e;
    if (!inMemory()) return target_->protectionClass(fd, protectionClass);
    struct stat st;
    if (fstat(fd, &st) != 0) return errno;
    std::lock_guard<std::mutex> l(m_);
    auto it = classes_.find({st.st_dev, st.st_ino});
    *protectionClass = it == classes_.end() ? 0 : it->second;
    return 0;
  }
  int setProtectionClass(int fd, uint32_t protectionClass) override {
    if (int e = enter(Operation::kSetProtectionClass)) return e;
    if (!inMemory()) return target_->setProtectionClass(fd, protectionClass);
    if (lockState_ && lockState_->currentLockState() == 1) return EPERM;
    struct stat st;
    if (fstat(fd, &st) != 0) return errno;
    std::lock_guard<std::mutex> l(m_);
    classes_[{st.st_dev, st.st_ino}] = protectionClass;
    return 0;
  }
  int immutableFlag(int fd, bool* immutable) override {
    if (int e = enter(Operation::kImmutableFlag)) return e;
    return target_->immutableFlag(fd, immutable);
  }
  int setImmutableFlag(int fd, bool immutable) override {
    if (int e = enter(Operation::kSetImmutableFlag)) return e;
    return target_->setImmutableFlag(fd, immutable);
  }
  int setGroupACL(const std::string& path, const std::vector<GroupACE>& entries) override {
    if (int e = enter(Operation::kSetGroupACL)) return e;
    return target_->setGroupACL(path, entries);
  }
  int copyItem(const std::string& from, const std::string& to) override {
    if (int e = enter(Operation::kCopyItem)) return e;
    return target_->copyItem(from, to);
  }
  int removeTree(const std::string& path, const RemovalErrorHandler& onError) override {
    if (int e = enter(Operation::kRemoveTree)) return e;
    return target_->removeTree(path, onError);
  }
  int directoryStatistics(const std::string& path, StatisticsMode mode, DirectoryStatistics* statistics) override {
    {
      std::lock_guard<std::mutex> l(m_);
      statisticsModes_.push_back(mode);
    }
    if (int e = enter(Operation::kDirectoryStatistics)) return e;
    {
      std::lock_guard<std::mutex> l(m_);
      auto it = statisticsOverride_.find(mode);
      if (it != statisticsOverride_.end()) {
        *statistics = it->second;
        return 0;
      }
    }
    return target_->directoryStatistics(path, mode, statistics);
  }
  int enableMaintainedDirectoryStatistics(const std::string& path) override {
    if (int e = enter(Operation::kEnableMaintainedDirectoryStatistics)) return e;
    return target_->enableMaintainedDirectoryStatistics(path);
  }
  std::vector<std::string> defaultSubdirectories(uint64_t containerClass) override {
    return target_->defaultSubdirectories(containerClass);
  }

 private:
  // Counts the call and returns the injected failure, if one is due.
  int enter(Operation op) {
    std::lock_guard<std::mutex> l(m_);
    calls_[op]++;
    auto it = failures_.find(op);
    if (it == failures_.end() || it->second.second <= 0) return 0;
    it->second.second--;
    return it->second.first;
  }
  bool inMemory() {
    std::lock_guard<std::mutex> l(m_);
    return inMemoryClasses_;
  }

  const std::shared_ptr<QRVFileSystemExtras> target_;
  const std::shared_ptr<QRVLockStateService> lockState_;
  std::mutex m_;
  std::map<Operation, std::pair<int, int>> failures_;  // errno, calls left
  std::map<Operation, int> calls_;
  std::vector<StatisticsMode> statisticsModes_;
  std::map<StatisticsMode, DirectoryStatistics> statisticsOverride_;
  bool inMemoryClasses_ = false;
  std::map<std::pair<dev_t, ino_t>, uint32_t> classes_;
};

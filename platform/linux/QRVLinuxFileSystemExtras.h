// The file-system extras on Linux.
//
// - Data-protection class: a 4-byte little-endian number in the extended
//   attribute "trusted.quorva.protection-class" (root only). No attribute, or
//   a file system without trusted attributes, reads as class 0. Setting any
//   class while the lock state is 1 fails with EPERM, as the device's own file
//   system refuses class changes while locked.
// - Immutable flag: FS_IOC_GETFLAGS / FS_IOC_SETFLAGS with FS_IMMUTABLE_FL.
// - Group ACLs: POSIX ACLs through libacl. An entry's rights become rwx bits
//   (read data = r; write, append or delete child = w; execute = x, and on a
//   directory any right to add entries also gives x, without which Linux lets
//   nobody add anything). The owner, owning-group and other entries keep what
//   the item has, so set the mode first. The mask is always rwx, so the named
//   entries are not cut down by the group bits of the mode. Inheritable
//   entries become the directory's default ACL, whose owner entry is rwx (the
//   creator of a new item keeps the rights its create mode asks for; Linux
//   checks the owner entry alone for the owner) and whose owning-group and
//   other entries grant nothing.
// - Copy: FICLONE, falling back to copy_file_range and then to read/write.
//   Hard links are copied as separate files, sockets are skipped, and the
//   immutable flag is not copied (a copy must stay removable).
// - Removal: a descriptor-relative walk (openat/unlinkat), so that neither
//   links nor the length of paths matter; it keeps at most kMaxOpenDirectories
//   directories open and re-finds shallower ones through "..", checking that
//   each is still the directory it left (QRVLinuxTreeRemover).
// - Directory statistics: a descriptor-relative walk to any depth summing
//   st_blocks * 512 as `du` does (hard-linked files once, links not followed,
//   other file systems left out), which fails rather than answer part of the
//   tree (QRVLinuxTreeStatistics). Fast-only answers from the same walk: Linux file systems keep no
//   directory sizes, so there is nothing faster to ask and nothing to enable.
#pragma once

#include <memory>

#include "platform/QRVFileSystemExtras.h"
#include "platform/QRVLockStateService.h"

class QRVLinuxFileSystemExtras : public QRVFileSystemExtras {
 public:
  static constexpr const char* kProtectionClassAttribute = "trusted.quorva.protection-class";
  static constexpr size_t kMaxOpenDirectories = 64;

  // `lockState` may be null: the device is then never locked.
  explicit QRVLinuxFileSystemExtras(std::shared_ptr<QRVLockStateService> lockState);

  int protectionClass(int fd, uint32_t* protectionClass) override;
  int setProtectionClass(int fd, uint32_t protectionClass) override;
  int immutableFlag(int fd, bool* immutable) override;
  int setImmutableFlag(int fd, bool immutable) override;
  int setGroupACL(const std::string& path, const std::vector<GroupACE>& entries) override;
  int copyItem(const std::string& from, const std::string& to) override;
  int removeTree(const std::string& path, const RemovalErrorHandler& onError) override;
  int directoryStatistics(const std::string& path, StatisticsMode mode, DirectoryStatistics* statistics) override;
  int enableMaintainedDirectoryStatistics(const std::string& path) override;
  std::vector<std::string> defaultSubdirectories(uint64_t containerClass) override;

 private:
  const std::shared_ptr<QRVLockStateService> lockState_;
};

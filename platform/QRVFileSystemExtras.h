// File-system services beyond POSIX that the file manager builds on:
// data-protection classes, the immutable flag, group ACLs, a copy that clones
// where it can, recursive removal with a per-entry error handler, directory
// statistics and the default subdirectories of a container class.
//
// Every operation returns 0 on success or the errno value of the call that
// failed; the caller words the error, so that each failure is reported once,
// by the code that knows what it was doing. None of them follows a symbolic
// link in the last component of a path it is given, and those that take a
// descriptor work on exactly that file.
//
// Thread-safety: implementations keep no per-call state and may be used from
// any thread.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

// Rights of an extended ACL entry, as the daemon describes them. A platform
// maps them onto what its file systems offer.
namespace QRVACLPermission {
constexpr uint32_t kReadData = 1u << 1;   // list a directory
constexpr uint32_t kWriteData = 1u << 2;  // add a file to a directory
constexpr uint32_t kExecute = 1u << 3;    // search a directory
constexpr uint32_t kDelete = 1u << 4;
constexpr uint32_t kAppendData = 1u << 5;  // add a subdirectory
constexpr uint32_t kDeleteChild = 1u << 6;
constexpr uint32_t kReadAttributes = 1u << 7;
constexpr uint32_t kWriteAttributes = 1u << 8;
constexpr uint32_t kReadExtendedAttributes = 1u << 9;
constexpr uint32_t kWriteExtendedAttributes = 1u << 10;
constexpr uint32_t kReadSecurity = 1u << 11;
constexpr uint32_t kWriteSecurity = 1u << 12;
constexpr uint32_t kChangeOwner = 1u << 13;
}  // namespace QRVACLPermission

// Inheritance flags of an extended ACL entry.
namespace QRVACLFlag {
constexpr uint32_t kInherited = 0x10;
constexpr uint32_t kFileInherit = 0x20;
constexpr uint32_t kDirectoryInherit = 0x40;
constexpr uint32_t kLimitInherit = 0x80;
constexpr uint32_t kOnlyInherit = 0x100;  // applies to new children only, not to the item itself
}  // namespace QRVACLFlag

class QRVFileSystemExtras {
 public:
  // One "allow" entry of an extended ACL that names a group.
  struct GroupACE {
    gid_t group = 0;
    uint32_t permissions = 0;  // QRVACLPermission bits
    uint32_t flags = 0;        // QRVACLFlag bits
  };

  // What a failing entry of a recursive removal looks like to its handler.
  // `directoryFD` is the open directory holding the entry and `name` its name
  // there, so that the handler can act on exactly that entry; `path` is for
  // messages only (it may be longer than the system accepts).
  // `directoryInTree` tells whether that directory is itself being removed
  // (false for the starting point's parent, which must be left alone).
  struct RemovalFailure {
    int directoryFD = -1;
    const char* name = nullptr;
    const std::string& path;
    int errnum = 0;
    bool directoryInTree = false;
  };
  // Returns true when it dealt with the failure so that the entry is gone;
  // false leaves the entry in place, and the removal goes on with the rest.
  using RemovalErrorHandler = std::function<bool(const RemovalFailure&)>;

  struct DirectoryStatistics {
    int64_t totalSize = 0;     // allocated bytes of the item and everything below it
    uint64_t descendants = 0;  // entries below the item
  };
  enum class StatisticsMode {
    kComprehensive,  // always answers, by walking the tree if need be
    kFastOnly,       // only from statistics the file system maintains; ENOTSUP when it keeps none
  };

  virtual ~QRVFileSystemExtras() = default;

  // Data-protection class of the open file `fd`. An item that was never given
  // a class reads as 0.
  virtual int protectionClass(int fd, uint32_t* protectionClass) = 0;
  // Fails with EPERM while the device is locked: classes cannot change then,
  // and callers use EPERM to know that they must retry after unlock.
  virtual int setProtectionClass(int fd, uint32_t protectionClass) = 0;

  // The immutable flag of the open regular file or directory `fd`. A file
  // system without the flag reads as not immutable.
  virtual int immutableFlag(int fd, bool* immutable) = 0;
  virtual int setImmutableFlag(int fd, bool immutable) = 0;

  // Replaces the extended ACL of `path` with `entries`. Entries without
  // kOnlyInherit govern the item; entries with kFileInherit or
  // kDirectoryInherit are what new children of a directory inherit.
  // Symbolic links carry no ACL: EOPNOTSUPP.
  virtual int setGroupACL(const std::string& path, const std::vector<GroupACE>& entries) = 0;

  // Copies `from` (recursively when it is a directory) to the new item `to`
  // with data, mode, owner, times and extended attributes (ACLs included),
  // cloning file data where the file system can. Links are copied as links.
  // An existing `to` fails with EEXIST; on failure nothing of the copy is
  // left behind.
  virtual int copyItem(const std::string& from, const std::string& to) = 0;

  // Removes `path` and, when it is a directory, everything below it, without
  // following links or entering other file systems and however deep the tree.
  // Each entry that cannot be removed goes to `onError` (when set) and the
  // removal goes on. Returns ENOENT when `path` does not exist, another errno
  // when the removal could not start or the tree changed shape beneath it,
  // and 0 otherwise (entry failures are the handler's to record).
  virtual int removeTree(const std::string& path, const RemovalErrorHandler& onError) = 0;

  virtual int directoryStatistics(const std::string& path, StatisticsMode mode, DirectoryStatistics* statistics) = 0;
  // Asks the file system to maintain statistics for the directory `path`, so
  // that later kFastOnly questions are answered.
  virtual int enableMaintainedDirectoryStatistics(const std::string& path) = 0;

  // The subdirectories (relative paths, parents first) that every container
  // of `containerClass` starts with.
  virtual std::vector<std::string> defaultSubdirectories(uint64_t containerClass) = 0;
};

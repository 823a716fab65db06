// The POSIX file-system calls the file manager is built on, one method per
// call, so that everything the daemon does to files goes through one object
// that tests can wrap: to make a single call fail halfway through an
// operation, or to record ownership changes that only root could make.
//
// Every method returns 0 on success or the errno value of the failing call,
// and stores its results only on success; the caller words the error, so
// that each failure is reported once, by the code that knows what it was
// doing. Methods that take a directory descriptor and a path behave as their
// *at(2) counterparts: the path is taken relative to the descriptor, or to
// the working directory for AT_FDCWD, and absolute paths ignore it. Nothing
// here adds or removes O_NOFOLLOW, AT_SYMLINK_NOFOLLOW or any other flag:
// whether a link is followed is always the caller's decision.
//
// Thread-safety: implementations keep no per-call state and may be used from
// any thread. Descriptors belong to the caller, who closes them with close().
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

class QRVFileSystem {
 public:
  // One entry of a directory as readDirectory() delivers it.
  struct DirectoryEntry {
    std::string name;
    unsigned char type = 0;  // DT_* of the entry, DT_UNKNOWN when the file system does not say
  };

  virtual ~QRVFileSystem() = default;

  // openat(2). `mode` only matters with O_CREAT or O_TMPFILE.
  virtual int open(int directoryFD, const std::string& path, int flags, mode_t mode, int* fd) = 0;
  // openat2(2) without O_CREAT: `resolve` holds the RESOLVE_* flags that
  // restrict how `path` is resolved (RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS
  // opens a path below `directoryFD` without following a link in any of its
  // components). ENOSYS where the kernel, or a seccomp filter, does not
  // offer the call: the caller then opens one component at a time.
  virtual int openResolved(int directoryFD, const std::string& path, int flags, uint64_t resolve, int* fd) = 0;
  // close(2). The descriptor is gone whatever the result.
  virtual int close(int fd) = 0;

  // mkdirat(2): `mode` is narrowed by the umask.
  virtual int makeDirectory(int directoryFD, const std::string& path, mode_t mode) = 0;
  // mkdtemp(3) and mkostemp(3): `pathTemplate` ends in "XXXXXX", which is
  // replaced by the name chosen. The directory is made with mode 0700, the
  // file with 0600 and opened read-write with the extra `flags`.
  virtual int makeTemporaryDirectory(std::string* pathTemplate) = 0;
  virtual int makeTemporaryFile(std::string* pathTemplate, int flags, int* fd) = 0;

  // renameat2(2); `flags` 0 is rename(2).
  virtual int rename(int fromDirectoryFD, const std::string& from, int toDirectoryFD, const std::string& to,
                     unsigned flags) = 0;
  // unlinkat(2): AT_REMOVEDIR removes an empty directory.
  virtual int unlink(int directoryFD, const std::string& path, int flags) = 0;

  // fchownat(2) and fchown(2). (uid_t)-1 and (gid_t)-1 leave that part alone.
  virtual int changeOwner(int directoryFD, const std::string& path, uid_t uid, gid_t gid, int flags) = 0;
  virtual int changeOwnerOfFD(int fd, uid_t uid, gid_t gid) = 0;
  // fchmodat(2) and fchmod(2). With AT_SYMLINK_NOFOLLOW a link itself fails
  // with EOPNOTSUPP: Linux gives links no mode of their own.
  virtual int changeMode(int directoryFD, const std::string& path, mode_t mode, int flags) = 0;
  virtual int changeModeOfFD(int fd, mode_t mode) = 0;

  // fstatat(2) and fstat(2).
  virtual int status(int directoryFD, const std::string& path, struct stat* st, int flags) = 0;
  virtual int statusOfFD(int fd, struct stat* st) = 0;

  // fsync(2) of one file, and syncfs(2) of the file system holding it.
  virtual int synchronize(int fd) = 0;
  virtual int synchronizeFileSystem(int fd) = 0;

  // readlinkat(2), whole: EINVAL when `path` is not a link.
  virtual int readLink(int directoryFD, const std::string& path, std::string* target) = 0;
  // realpath(3): `path` with every link resolved, absolute and without ".",
  // ".." or repeated slashes. Every component must exist.
  virtual int realPath(const std::string& path, std::string* resolved) = 0;

  // Every entry of the open directory `fd` except "." and "..", in the order
  // the file system hands them out. The descriptor stays the caller's and its
  // read position is not used: the directory is read from its start.
  virtual int readDirectory(int fd, std::vector<DirectoryEntry>* entries) = 0;

  // read(2) and write(2), retried on EINTR; `*done` is how many bytes moved
  // (fewer than `size` at the end of a file, or for a short write).
  virtual int read(int fd, void* buffer, size_t size, size_t* done) = 0;
  virtual int write(int fd, const void* buffer, size_t size, size_t* done) = 0;
};

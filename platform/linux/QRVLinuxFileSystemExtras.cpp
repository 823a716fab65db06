#include "platform/linux/QRVLinuxFileSystemExtras.h"

#include <acl/libacl.h>
#include <dirent.h>
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/acl.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <map>
#include <unordered_set>
#include <utility>

#include "platform/linux/QRVDirectoryReader.h"
#include "platform/linux/QRVLinuxTreeRemover.h"
#include "platform/linux/QRVLinuxTreeStatistics.h"

namespace {

// Owns a descriptor for the length of a scope.
class ScopedFD {
 public:
  explicit ScopedFD(int fd = -1) : fd_(fd) {}
  ~ScopedFD() {
    if (fd_ >= 0) close(fd_);
  }
  ScopedFD(const ScopedFD&) = delete;
  ScopedFD& operator=(const ScopedFD&) = delete;
  int get() const { return fd_; }
  explicit operator bool() const { return fd_ >= 0; }

 private:
  int fd_;
};

// Splits `path` into its directory and last component. Fails for paths that
// name no removable or creatable entry ("/", ".", "..").
bool splitPath(const std::string& path, std::string* directory, std::string* name) {
  std::string p = path;
  while (p.size() > 1 && p.back() == '/') p.pop_back();
  size_t slash = p.rfind('/');
  if (slash == std::string::npos) {
    *directory = ".";
    *name = p;
  } else {
    *directory = slash == 0 ? "/" : p.substr(0, slash);
    *name = p.substr(slash + 1);
  }
  return !name->empty() && *name != "." && *name != ".." && *name != "/";
}

int openDirectory(const std::string& path) { return open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC); }

// ---- ACLs ----

// The rwx bits that stand for an entry's rights on Linux.
acl_perm_t linuxPermissions(uint32_t permissions, bool forDirectory) {
  using namespace QRVACLPermission;
  acl_perm_t bits = 0;
  if (permissions & kReadData) bits |= ACL_READ;
  if (permissions & (kWriteData | kAppendData | kDeleteChild)) bits |= ACL_WRITE;
  if (permissions & kExecute) bits |= ACL_EXECUTE;
  // Adding entries to a Linux directory needs search permission as well.
  if (forDirectory && (permissions & (kWriteData | kAppendData))) bits |= ACL_EXECUTE;
  return bits;
}

int addEntry(acl_t* acl, acl_tag_t tag, acl_perm_t perms, const gid_t* qualifier) {
  acl_entry_t entry;
  acl_permset_t permset;
  if (acl_create_entry(acl, &entry) != 0 || acl_set_tag_type(entry, tag) != 0) return errno;
  if (qualifier && acl_set_qualifier(entry, qualifier) != 0) return errno;
  if (acl_get_permset(entry, &permset) != 0 || acl_clear_perms(permset) != 0) return errno;
  for (acl_perm_t p : {ACL_READ, ACL_WRITE, ACL_EXECUTE})
    if ((perms & p) && acl_add_perm(permset, p) != 0) return errno;
  return acl_set_permset(entry, permset) == 0 ? 0 : errno;
}

// Sets an ACL of `type` made of the three base entries and `named` group
// entries (with an rwx mask when there are any) on `path`.
int applyACL(const std::string& path, acl_type_t type, acl_perm_t owner, acl_perm_t owningGroup, acl_perm_t other,
             const std::map<gid_t, acl_perm_t>& named) {
  acl_t acl = acl_init(static_cast<int>(4 + named.size()));
  if (!acl) return errno;
  int e = addEntry(&acl, ACL_USER_OBJ, owner, nullptr);
  if (!e) e = addEntry(&acl, ACL_GROUP_OBJ, owningGroup, nullptr);
  if (!e) e = addEntry(&acl, ACL_OTHER, other, nullptr);
  for (const auto& [gid, perms] : named) {
    if (e) break;
    e = addEntry(&acl, ACL_GROUP, perms, &gid);
  }
  if (!e && !named.empty()) e = addEntry(&acl, ACL_MASK, ACL_READ | ACL_WRITE | ACL_EXECUTE, nullptr);
  if (!e && acl_valid(acl) != 0) e = EINVAL;
  if (!e && acl_set_file(path.c_str(), type, acl) != 0) e = errno;
  acl_free(acl);
  return e;
}

// The owner, owning-group and other rights of the access ACL at `path` (which
// mirrors the mode when the item has no ACL).
int baseRights(const std::string& path, acl_perm_t* owner, acl_perm_t* owningGroup, acl_perm_t* other) {
  acl_t acl = acl_get_file(path.c_str(), ACL_TYPE_ACCESS);
  if (!acl) return errno;
  *owner = *owningGroup = *other = 0;
  acl_entry_t entry;
  for (int r = acl_get_entry(acl, ACL_FIRST_ENTRY, &entry); r == 1; r = acl_get_entry(acl, ACL_NEXT_ENTRY, &entry)) {
    acl_tag_t tag;
    acl_permset_t permset;
    if (acl_get_tag_type(entry, &tag) != 0 || acl_get_permset(entry, &permset) != 0) continue;
    acl_perm_t perms = 0;
    for (acl_perm_t p : {ACL_READ, ACL_WRITE, ACL_EXECUTE})
      if (acl_get_perm(permset, p) == 1) perms |= p;
    if (tag == ACL_USER_OBJ) *owner = perms;
    if (tag == ACL_GROUP_OBJ) *owningGroup = perms;
    if (tag == ACL_OTHER) *other = perms;
  }
  acl_free(acl);
  return 0;
}

// ---- Copy ----

bool ignorableAttributeFailure(int e) { return e == ENOTSUP || e == EPERM; }

int copyExtendedAttributes(int from, int to) {
  std::vector<char> names;
  for (;;) {
    ssize_t n = flistxattr(from, nullptr, 0);
    if (n < 0) return errno == ENOTSUP ? 0 : errno;
    if (n == 0) return 0;
    names.resize(static_cast<size_t>(n));
    n = flistxattr(from, names.data(), names.size());
    if (n >= 0) {
      names.resize(static_cast<size_t>(n));
      break;
    }
    if (errno != ERANGE) return errno;  // the list grew meanwhile: ask again
  }
  std::vector<char> value;
  for (size_t i = 0; i < names.size(); i += strlen(&names[i]) + 1) {
    const char* name = &names[i];
    ssize_t n;
    for (;;) {
      n = fgetxattr(from, name, nullptr, 0);
      if (n < 0) break;
      value.resize(static_cast<size_t>(n));
      n = fgetxattr(from, name, value.data(), value.size());
      if (n >= 0 || errno != ERANGE) break;
    }
    if (n < 0) {
      if (errno == ENODATA || ignorableAttributeFailure(errno)) continue;
      return errno;
    }
    if (fsetxattr(to, name, value.data(), static_cast<size_t>(n), 0) != 0 && !ignorableAttributeFailure(errno))
      return errno;
  }
  return 0;
}

// Owner, mode, extended attributes and times, in that order: a change of
// owner clears set-id bits, and a mode written after the ACL would rewrite
// its mask.
int copyMetadata(int from, int to, const struct stat& st) {
  if (fchown(to, st.st_uid, st.st_gid) != 0 && errno != EPERM) return errno;
  if (fchmod(to, st.st_mode & 07777) != 0) return errno;
  if (int e = copyExtendedAttributes(from, to)) return e;
  struct timespec times[2] = {st.st_atim, st.st_mtim};
  return futimens(to, times) == 0 ? 0 : errno;
}

int copyData(int from, int to) {
  if (ioctl(to, FICLONE, from) == 0) return 0;
  bool copiedAny = false;
  for (;;) {
    ssize_t n = copy_file_range(from, nullptr, to, nullptr, size_t{1} << 30, 0);
    if (n > 0) {
      copiedAny = true;
      continue;
    }
    if (n == 0) return 0;
    if (errno == EINTR) continue;
    if (!copiedAny && (errno == EXDEV || errno == ENOSYS || errno == EOPNOTSUPP || errno == EINVAL)) break;
    return errno;
  }
  std::vector<char> buffer(size_t{1} << 17);
  for (;;) {
    ssize_t n = read(from, buffer.data(), buffer.size());
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return errno;
    if (n == 0) return 0;
    for (ssize_t done = 0; done < n;) {
      ssize_t w = write(to, buffer.data() + done, static_cast<size_t>(n - done));
      if (w < 0 && errno == EINTR) continue;
      if (w < 0) return errno;
      done += w;
    }
  }
}

int copyEntry(int fromDirectory, const char* fromName, int toDirectory, const char* toName) {
  struct stat st;
  if (fstatat(fromDirectory, fromName, &st, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  switch (st.st_mode & S_IFMT) {
    case S_IFREG: {
      ScopedFD in(openat(fromDirectory, fromName, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
      if (!in) return errno;
      if (fstat(in.get(), &st) != 0) return errno;
      if (!S_ISREG(st.st_mode)) return ESTALE;  // replaced while we looked
      ScopedFD out(openat(toDirectory, toName, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
      if (!out) return errno;
      if (int e = copyData(in.get(), out.get())) return e;
      return copyMetadata(in.get(), out.get(), st);
    }
    case S_IFDIR: {
      ScopedFD in(openat(fromDirectory, fromName, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
      if (!in) return errno;
      if (mkdirat(toDirectory, toName, 0700) != 0) return errno;
      ScopedFD out(openat(toDirectory, toName, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
      if (!out) return errno;
      const int from = in.get(), to = out.get();
      if (int e = QRVForEachDirectoryEntry(
              from, [&](const dirent& entry) { return copyEntry(from, entry.d_name, to, entry.d_name); }))
        return e;
      // After the contents, so that their creation does not change the times.
      return copyMetadata(in.get(), out.get(), st);
    }
    case S_IFLNK: {
      std::vector<char> target(static_cast<size_t>(st.st_size) + 2);
      for (;;) {
        ssize_t n = readlinkat(fromDirectory, fromName, target.data(), target.size());
        if (n < 0) return errno;
        if (static_cast<size_t>(n) < target.size()) {
          target[static_cast<size_t>(n)] = '\0';
          break;
        }
        target.resize(target.size() * 2);  // the link changed meanwhile
      }
      if (symlinkat(target.data(), toDirectory, toName) != 0) return errno;
      if (fchownat(toDirectory, toName, st.st_uid, st.st_gid, AT_SYMLINK_NOFOLLOW) != 0 && errno != EPERM) return errno;
      struct timespec times[2] = {st.st_atim, st.st_mtim};
      return utimensat(toDirectory, toName, times, AT_SYMLINK_NOFOLLOW) == 0 ? 0 : errno;
    }
    case S_IFIFO:
    case S_IFCHR:
    case S_IFBLK: {
      if (mknodat(toDirectory, toName, (st.st_mode & S_IFMT) | 0600, st.st_rdev) != 0) return errno;
      if (fchownat(toDirectory, toName, st.st_uid, st.st_gid, AT_SYMLINK_NOFOLLOW) != 0 && errno != EPERM) return errno;
      if (fchmodat(toDirectory, toName, st.st_mode & 07777, 0) != 0) return errno;
      struct timespec times[2] = {st.st_atim, st.st_mtim};
      return utimensat(toDirectory, toName, times, AT_SYMLINK_NOFOLLOW) == 0 ? 0 : errno;
    }
    default:
      return 0;  // a socket means nothing without the process that bound it
  }
}

// ---- Removal ----

// Removes one directory tree from the bottom up, descriptor-relative. Each
// directory being emptied is a frame; frames far from the current one have
// their stream closed to bound the descriptors in use, and are re-found
// through ".." of their child when the walk climbs back.

}  // namespace

QRVLinuxFileSystemExtras::QRVLinuxFileSystemExtras(std::shared_ptr<QRVLockStateService> lockState)
    : lockState_(std::move(lockState)) {}

int QRVLinuxFileSystemExtras::protectionClass(int fd, uint32_t* protectionClass) {
  uint8_t bytes[4];
  ssize_t n = fgetxattr(fd, kProtectionClassAttribute, bytes, sizeof bytes);
  if (n < 0) {
    if (errno == ENODATA || errno == ENOTSUP) {
      *protectionClass = 0;
      return 0;
    }
    return errno == ERANGE ? EINVAL : errno;  // longer than a class number: not one of ours
  }
  if (n != sizeof bytes) return EINVAL;
  *protectionClass = uint32_t{bytes[0]} | uint32_t{bytes[1]} << 8 | uint32_t{bytes[2]} << 16 | uint32_t{bytes[3]} << 24;
  return 0;
}

int QRVLinuxFileSystemExtras::setProtectionClass(int fd, uint32_t protectionClass) {
  if (lockState_ && lockState_->currentLockState() == 1) return EPERM;
  uint8_t bytes[4] = {static_cast<uint8_t>(protectionClass), static_cast<uint8_t>(protectionClass >> 8),
                      static_cast<uint8_t>(protectionClass >> 16), static_cast<uint8_t>(protectionClass >> 24)};
  return fsetxattr(fd, kProtectionClassAttribute, bytes, sizeof bytes, 0) == 0 ? 0 : errno;
}

int QRVLinuxFileSystemExtras::immutableFlag(int fd, bool* immutable) {
  *immutable = false;
  struct stat st;
  if (fstat(fd, &st) != 0) return errno;
  // On anything else the ioctl would reach a device driver, not the file system.
  if (!S_ISREG(st.st_mode) && !S_ISDIR(st.st_mode)) return 0;
  int flags = 0;
  if (ioctl(fd, FS_IOC_GETFLAGS, &flags) != 0)
    return (errno == ENOTTY || errno == ENOTSUP || errno == EINVAL) ? 0 : errno;
  *immutable = (flags & FS_IMMUTABLE_FL) != 0;
  return 0;
}

int QRVLinuxFileSystemExtras::setImmutableFlag(int fd, bool immutable) {
  struct stat st;
  if (fstat(fd, &st) != 0) return errno;
  if (!S_ISREG(st.st_mode) && !S_ISDIR(st.st_mode)) return ENOTSUP;
  int flags = 0;
  if (ioctl(fd, FS_IOC_GETFLAGS, &flags) != 0) return errno == ENOTTY ? ENOTSUP : errno;
  int wanted = immutable ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
  if (wanted == flags) return 0;
  if (ioctl(fd, FS_IOC_SETFLAGS, &wanted) != 0) return errno == ENOTTY ? ENOTSUP : errno;
  return 0;
}

int QRVLinuxFileSystemExtras::setGroupACL(const std::string& path, const std::vector<GroupACE>& entries) {
  // An O_PATH descriptor pins the item without opening it (a device node is
  // never opened); its /proc name lets the path-based ACL calls act on that
  // item and no other.
  ScopedFD fd(open(path.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  if (!fd) return errno;
  struct stat st;
  if (fstat(fd.get(), &st) != 0) return errno;
  if (S_ISLNK(st.st_mode)) return EOPNOTSUPP;
  const bool isDirectory = S_ISDIR(st.st_mode);
  const std::string pinned = "/proc/self/fd/" + std::to_string(fd.get());

  std::map<gid_t, acl_perm_t> own, inherited;
  for (const GroupACE& ace : entries) {
    if (!(ace.flags & QRVACLFlag::kOnlyInherit)) own[ace.group] |= linuxPermissions(ace.permissions, isDirectory);
    if (isDirectory && (ace.flags & (QRVACLFlag::kFileInherit | QRVACLFlag::kDirectoryInherit)))
      inherited[ace.group] |= linuxPermissions(ace.permissions, true);
  }
  acl_perm_t owner = 0, owningGroup = 0, other = 0;
  if (int e = baseRights(pinned, &owner, &owningGroup, &other)) return e;
  if (int e = applyACL(pinned, ACL_TYPE_ACCESS, owner, owningGroup, other, own)) return e;
  if (!isDirectory) return 0;
  if (inherited.empty()) return acl_delete_def_file(pinned.c_str()) == 0 ? 0 : errno;
  return applyACL(pinned, ACL_TYPE_DEFAULT, ACL_READ | ACL_WRITE | ACL_EXECUTE, 0, 0, inherited);
}

int QRVLinuxFileSystemExtras::copyItem(const std::string& from, const std::string& to) {
  std::string fromDirectory, fromName, toDirectory, toName;
  if (!splitPath(from, &fromDirectory, &fromName) || !splitPath(to, &toDirectory, &toName)) return EINVAL;
  ScopedFD source(openDirectory(fromDirectory));
  if (!source) return errno;
  ScopedFD destination(openDirectory(toDirectory));
  if (!destination) return errno;
  struct stat st;
  if (fstatat(destination.get(), toName.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0) return EEXIST;
  if (errno != ENOENT) return errno;
  int e = copyEntry(source.get(), fromName.c_str(), destination.get(), toName.c_str());
  if (e && e != EEXIST) {
    // Leave no half copy behind.
    QRVLinuxTreeRemover remover(nullptr, to);
    remover.run(destination.get(), toName);
  }
  return e;
}

int QRVLinuxFileSystemExtras::removeTree(const std::string& path, const RemovalErrorHandler& onError) {
  std::string directory, name;
  if (!splitPath(path, &directory, &name)) return EINVAL;
  ScopedFD parent(openDirectory(directory));
  if (!parent) return errno;
  QRVLinuxTreeRemover remover(onError, path);
  return remover.run(parent.get(), name);
}

int QRVLinuxFileSystemExtras::directoryStatistics(const std::string& path, StatisticsMode,
                                                  DirectoryStatistics* statistics) {
  QRVLinuxTreeStatistics walk;
  return walk.run(path, statistics);
}

int QRVLinuxFileSystemExtras::enableMaintainedDirectoryStatistics(const std::string&) { return 0; }

std::vector<std::string> QRVLinuxFileSystemExtras::defaultSubdirectories(uint64_t containerClass) {
  switch (containerClass) {
    case 2:
    case 4:
    case 6:
      return {"Documents", "Library", "Library/Caches", "Library/Preferences", "SystemData", "tmp"};
    case 7:
      return {"Library", "Library/Caches", "Library/Preferences"};
    case 9:
    case 10:
    case 12:
      return {"Library", "tmp"};
    case 11:
      return {"tmp"};
    case 13:
      return {"Library"};
    default:
      return {};
  }
}

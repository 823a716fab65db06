// Data-protection classes of single items, and the ACLs of system containers.
#include <fcntl.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "fs/QRVFileManager.h"

namespace {

using QRVACLPermission::kAppendData;
using QRVACLPermission::kChangeOwner;
using QRVACLPermission::kDelete;
using QRVACLPermission::kDeleteChild;
using QRVACLPermission::kExecute;
using QRVACLPermission::kReadAttributes;
using QRVACLPermission::kReadData;
using QRVACLPermission::kReadExtendedAttributes;
using QRVACLPermission::kReadSecurity;
using QRVACLPermission::kWriteAttributes;
using QRVACLPermission::kWriteData;
using QRVACLPermission::kWriteExtendedAttributes;
using QRVACLPermission::kWriteSecurity;

// Everything a system service may do in a directory of a system container.
constexpr uint32_t kSystemDirectoryRights = kReadData | kWriteData | kExecute | kDelete | kAppendData | kDeleteChild |
                                            kReadAttributes | kWriteAttributes | kReadExtendedAttributes |
                                            kWriteExtendedAttributes | kReadSecurity | kWriteSecurity | kChangeOwner;
// The same for a file, where "delete child" means nothing.
constexpr uint32_t kSystemFileRights = kSystemDirectoryRights & ~kDeleteChild;
// On the container directory itself: add entries and use extended
// attributes, but not list or remove what others put there.
constexpr uint32_t kSystemTopLevelRights =
    kWriteData | kAppendData | kReadExtendedAttributes | kWriteExtendedAttributes;
static_assert(kSystemDirectoryRights == 0x3FFE && kSystemFileRights == 0x3FBE && kSystemTopLevelRights == 0x624);

constexpr uint32_t kInheritToChildren = QRVACLFlag::kFileInherit | QRVACLFlag::kDirectoryInherit;
static_assert(kInheritToChildren == 0x60 && (kInheritToChildren | QRVACLFlag::kOnlyInherit) == 0x160);

std::string errnoText(int e) { return strerror(e); }

bool containsMetadataFileName(std::string_view path) {
  return path.find(QRVFileManager::kMetadataFileName) != std::string_view::npos;
}

// Opens one item for its class without following a link and without
// blocking on a fifo.
constexpr int kOpenItemFlags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;

}  // namespace

// ---- Data-protection classes ----

bool QRVFileManager::setDataProtectionClassOfItemAtURL(const std::string& url, uint32_t toClass,
                                                       const std::function<bool(uint32_t)>& ifPredicate,
                                                       QRVError* error) {
  int fd = -1;
  if (int e = _open(url, kOpenItemFlags, &fd))
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to open {} : {}", url, errnoText(e)));
  bool ok = setDataProtectionClassOfOpenItem(fd, url, toClass, ifPredicate, error);
  _close(fd);
  return ok;
}

bool QRVFileManager::setDataProtectionClassOfOpenItem(int fd, std::string_view path, uint32_t toClass,
                                                      const std::function<bool(uint32_t)>& ifPredicate,
                                                      QRVError* error) {
  if (ifPredicate) {
    uint32_t current = 0;
    if (int e = extras_->protectionClass(fd, &current))
      return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to getclass of file {}: {}", path, errnoText(e)));
    if (!ifPredicate(current)) return true;
  }
  if (int e = extras_->setProtectionClass(fd, toClass))
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to setclass({}) on file {}: {}", static_cast<int32_t>(toClass),
                                          path, errnoText(e)));
  return true;
}

bool QRVFileManager::dataProtectionClassOfItemAtURL(const std::string& url, uint32_t* protectionClass,
                                                    QRVError* error) {
  int fd = -1;
  if (int e = _open(url, kOpenItemFlags, &fd))
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to open {} : {}", url, errnoText(e)));
  int e = extras_->protectionClass(fd, protectionClass);
  _close(fd);
  if (e) return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to getclass of file {}: {}", url, errnoText(e)));
  return true;
}

// ---- ACLs ----

std::optional<gid_t> QRVFileManager::_systemUsersGroup(QRVError* error) {
  std::optional<gid_t> group = accounts_ ? accounts_->groupIDForName(kSystemUsersGroupName) : std::nullopt;
  if (!group)
    QRVFail(error,
            QRV_POSIX_ERROR(ENOENT, "Failed to find the group {}: {}", kSystemUsersGroupName, errnoText(ENOENT)));
  return group;
}

bool QRVFileManager::_CreateSystemUserACEInACL(ACL* acl, uint32_t withPermissions, uint32_t andFlags, QRVError* error) {
  std::optional<gid_t> group = _systemUsersGroup(error);
  if (!group) return false;
  acl->push_back({*group, withPermissions, andFlags});
  return true;
}

std::optional<QRVFileManager::ACL> QRVFileManager::_CopySystemContainerACLWithNumACEs(int numACEs, bool isDir,
                                                                                      bool inheritOnly,
                                                                                      QRVError* error) {
  ACL acl;
  acl.reserve(static_cast<size_t>(std::max(numACEs, 1)));
  uint32_t permissions = isDir ? kSystemDirectoryRights : kSystemFileRights;
  uint32_t flags = isDir ? (kInheritToChildren | (inheritOnly ? QRVACLFlag::kOnlyInherit : 0)) : QRVACLFlag::kInherited;
  if (!_CreateSystemUserACEInACL(&acl, permissions, flags, error)) return std::nullopt;
  return acl;
}

std::optional<QRVFileManager::ACL> QRVFileManager::_CopyTopLevelSystemContainerACLWithError(QRVError* error) {
  std::optional<ACL> acl = _CopySystemContainerACLWithNumACEs(2, /*isDir=*/true, /*inheritOnly=*/true, error);
  if (!acl || !_CreateSystemUserACEInACL(&*acl, kSystemTopLevelRights, 0, error)) return std::nullopt;
  return acl;
}

bool QRVFileManager::standardizeACLsAtURL(const std::string& url, bool isSystemContainer, QRVError* error) {
  std::optional<ACL> topLevel = _CopyTopLevelSystemContainerACLWithError(error);
  if (!topLevel) return false;
  std::optional<ACL> directory = _CopySystemContainerACLWithNumACEs(1, /*isDir=*/true, /*inheritOnly=*/false, error);
  if (!directory) return false;
  std::optional<ACL> file = _CopySystemContainerACLWithNumACEs(1, /*isDir=*/false, /*inheritOnly=*/false, error);
  if (!file) return false;

  return _traverseDirectory(url, error, [&](const QRVDirectoryEntry& entry, QRVError*) {
    if (entry.kind == QRVDirectoryEntry::Kind::kDirectoryPostOrder || containsMetadataFileName(entry.path)) return true;
    std::string path(entry.path);
    const bool isDirectory = S_ISDIR(entry.stat->st_mode);
    const bool isLink = S_ISLNK(entry.stat->st_mode);
    if (isDirectory && entry.level == 0 && isSystemContainer) {
      if (int e = extras_->setGroupACL(path, *topLevel))
        QRVLogError("Failed to set top level ACL on dir {}: {}", path, errnoText(e));
      return true;
    }
    // Mode and owner before the ACL: on Linux a chmod rewrites the ACL mask,
    // and access to a system container is meant to be by its ACL alone.
    if (!isLink) {
      if (int e = files_->changeMode(AT_FDCWD, path, 0, AT_SYMLINK_NOFOLLOW))
        QRVLogError("Could not chmod {}: {}", path, errnoText(e));
    }
    if (int e = files_->changeOwner(AT_FDCWD, path, kSystemContainerOwner, kSystemContainerOwner, AT_SYMLINK_NOFOLLOW))
      QRVLogError("Could not chown {}: {}", path, errnoText(e));
    if (!isLink) {  // links carry no ACL on Linux
      if (int e = extras_->setGroupACL(path, isDirectory ? *directory : *file))
        QRVLogError("Failed to set ACL on dir {}: {}", path, errnoText(e));
    }
    return true;
  });
}

bool QRVFileManager::standardizeACLsForSystemContainerAtURL(const std::string& url, QRVError* error) {
  return standardizeACLsAtURL(url, true, error);
}

bool QRVFileManager::setTopLevelSystemContainerACLAtURL(const std::string& url, QRVError* error) {
  std::optional<ACL> topLevel = _CopyTopLevelSystemContainerACLWithError(error);
  if (!topLevel) return false;
  if (int e = extras_->setGroupACL(url, *topLevel))
    return QRVFail(error, QRV_POSIX_ERROR(e, "Failed to set top level ACL on dir {}: {}", url, errnoText(e)));
  return true;
}

bool QRVFileManager::standardizeAllSystemContainerACLsAtURL(const std::string& url, QRVError* error) {
  QRVError listError;
  std::optional<std::vector<std::string>> items = urlsForItemsInDirectoryAtURL(url, &listError);
  if (!items) {
    QRVLogError("Failed to get items at URL{} : {}", url, listError.description());
    return QRVFail(error, std::move(listError));
  }
  QRVLogNotice("Potential containers requiring ACL migration: ({})", fmt::join(*items, ", "));
  for (const std::string& item : *items) {
    QRVError itemError;
    if (!standardizeACLsForSystemContainerAtURL(item, &itemError))
      QRVLogError("Failed to set system container ACL at {}: {}", item, itemError.description());
  }
  return true;
}

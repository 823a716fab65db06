// The daemon's one gateway to the file system: safe resolution of paths that
// clients supply, directory creation with mode, owner and data-protection
// class, copy, move and recursive removal, temporary directories, ownership
// and ACL standardisation of container trees, data-protection classes of
// single items, disk usage, listing and traversal, and the home directory of
// a uid.
//
// Every failure is an error of the POSIX domain whose code is the errno of
// the call that failed (the one exception is documented at removeItemAtURL).
// Operations return a success flag, or an optional result that is empty on
// failure, and store the error through `error` when it is not null.
//
// Paths ("URLs") are absolute path strings. The file manager keeps no state
// of its own: it is reentrant, and callers serialise work on one tree through
// the identifier locks. It reaches the operating system only through the two
// objects it is given: every POSIX call goes through the QRVFileSystem, and
// what lies beyond POSIX (classes, the immutable flag, group ACLs, cloning
// copies, recursive removal, directory statistics) through the
// QRVFileSystemExtras. Tests wrap either to make single calls fail.
//
// The implementation is split by concern: QRVFileManager.cpp (construction,
// whole files, homes), QRVFileManagerPaths.cpp (paths supplied by clients),
// QRVFileManagerCreation.cpp (creation and ownership),
// QRVFileManagerRemoval.cpp (move, copy, remove), QRVFileManagerProtection.cpp
// (classes and ACLs) and QRVFileManagerUsage.cpp (listing, traversal, sizes).
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/QRVError.h"
#include "platform/QRVAccounts.h"
#include "platform/QRVFeatureFlags.h"
#include "platform/QRVFileSystem.h"
#include "platform/QRVFileSystemExtras.h"

class QRVOpenDirectory;

// One entry of a traversal, as the walk delivers it.
struct QRVDirectoryEntry {
  enum class Kind {
    kDirectory,           // before its contents
    kDirectoryPostOrder,  // after its contents
    kRegularFile,
    kSymbolicLink,         // never followed
    kDirectoryCycle,       // a directory that is also one of its own ancestors
    kUnreadableDirectory,  // its contents could not be read (errnum says why)
    kOther,                // fifos, sockets, devices
  };
  Kind kind;
  std::string_view path;
  int level;                // 0 for the starting point
  const struct stat* stat;  // the entry's own (link) status
  int errnum;               // for kUnreadableDirectory
  // Only in walks that never follow links: an open descriptor of exactly this
  // directory or regular file, to act on it without naming it by path again;
  // -1 for every other kind. It is the walk's, valid during the call.
  int fd = -1;
};

class QRVFileManager {
 public:
  // The data-protection class that means "leave the class alone".
  static constexpr uint32_t kLeaveProtectionClassAlone = 0xFFFFFFFF;
  // The container metadata file: ownership and ACL standardisation skip every
  // path that contains this name.
  static constexpr const char* kMetadataFileName = ".com.kelva.quorva.metadata.plist";
  // The group whose members may use system containers.
  static constexpr const char* kSystemUsersGroupName = "systemusers";
  // Owner and group of every entry inside a system container, which is used
  // through its ACL alone: "nobody".
  static constexpr uid_t kSystemContainerOwner = 65534;
  // Code of the daemon's own domain for a removal given no path.
  static constexpr uint64_t kNoURLForRemoval = QRVResultCode::kOldNotMovedAside;

  // `root` is the directory every absolute path of the system lives under
  // ("/" on a device); it places home directories.
  QRVFileManager(std::string root, std::shared_ptr<QRVFileSystem> files, std::shared_ptr<QRVFileSystemExtras> extras,
                 std::shared_ptr<QRVAccounts> accounts, std::shared_ptr<QRVFeatureFlags> featureFlags);

  // ---- Paths supplied by clients ----

  // The resolved path of `url` (a "suspicious" path) when it provably lies
  // inside `ifChildOfURL` or is that directory; nothing otherwise. Refuses
  // "..", absolute link targets, links that climb out of the base, and any
  // path whose resolution (links included, also chains of them) leaves the
  // base. Components that do not exist yet are appended unresolved to the
  // resolved existing part; an existing link that cannot be resolved is
  // refused. Every refusal is logged.
  std::optional<std::string> realPathForURL(const std::string& url, const std::string& ifChildOfURL);

  // lstat-based. itemExistsAtURL is true when lstat succeeds;
  // itemDoesNotExistAtURL only when it fails with ENOENT. Other failures are
  // logged and make both false.
  bool itemExistsAtURL(const std::string& url);
  bool itemDoesNotExistAtURL(const std::string& url);
  // True when `url` itself (not a link to one) is a directory.
  bool directoryExistsAtURL(const std::string& url);
  // Give the directory `url` to uid:gid, or `mode`, through a descriptor
  // opened without following links, so that a link put in its place in the
  // meantime is refused (ELOOP/ENOTDIR) instead of followed.
  bool setOwnerOfDirectoryAtURL(const std::string& url, uid_t uid, gid_t gid, QRVError* error);
  bool setModeOfDirectoryAtURL(const std::string& url, mode_t mode, QRVError* error);

  // ---- Listing and traversal ----

  // The directories, regular files and links directly inside `url`, without
  // names that begin with ".", sorted by name. A missing directory fails with
  // ENOENT without logging.
  std::optional<std::vector<std::string>> urlsForItemsInDirectoryAtURL(const std::string& url, QRVError* error);
  // The same in two steps, for a caller that goes on to read files below
  // the directory through the descriptor: openDirectoryAtURL fails as the
  // listing does when `url` cannot be opened (links in `url` are followed,
  // as for a listing), and urlsForItemsInDirectory lists what it opened.
  std::unique_ptr<QRVOpenDirectory> openDirectoryAtURL(const std::string& url, QRVError* error);
  std::optional<std::vector<std::string>> urlsForItemsInDirectory(const QRVOpenDirectory& directory,
                                                                  QRVError* error);

  // Called for each entry of a walk; returning false ends the walk, and what
  // the block stored through its error argument becomes the walk's error.
  using TraversalBlock = std::function<bool(const QRVDirectoryEntry& entry, QRVError* error)>;

  // Walks `url` and everything below it, to any depth, fd-relative: every
  // entry is examined and opened relative to its directory's descriptor and
  // never through a link (O_NOFOLLOW), so that a link or a directory an
  // application swaps in while the walk runs is never followed out of the
  // tree. Entries arrive as with the path walk (pre-order, directories again
  // after their contents, a mount point visited but not entered, a directory
  // whose contents cannot be read as kUnreadableDirectory instead of its
  // post-order visit), directories and regular files with `fd` set. Entries
  // that vanish (or turn into a link) between listing and opening are left
  // out: they are not errors. What is delivered is what the descriptor shows,
  // not what the listing said. At most a fixed number of directory
  // descriptors stay open however deep the tree; an ancestor closed on the
  // way down is opened again through ".." and must be the same directory,
  // otherwise (it was moved during the walk) the walk fails with ESTALE. A
  // `url` that does not exist is an empty walk; a `url` that cannot be
  // examined fails with its errno.
  bool traverseItemAtURLWithoutFollowingLinks(const std::string& url, QRVError* error, const TraversalBlock& block);

  // ---- Creation ----

  // Creates the directory `url` with exactly `mode` (the umask does not
  // narrow it; with `withIntermediateDirectories` its missing parents get the
  // same mode). An existing directory is success and is then treated as new:
  // unless `protectionClass` is kLeaveProtectionClassAlone it gets that
  // class, and unless `owner` is 0 it is given to owner:owner (the group is
  // deliberately the same number; owner 0 leaves ownership alone). An
  // existing item that is not a directory fails with EEXIST.
  bool createDirectoryAtURL(const std::string& url, bool withIntermediateDirectories, mode_t mode, uid_t owner,
                            uint32_t protectionClass, QRVError* error);
  // The shorthands: owner 0 and/or the class left alone. (Owner and class are
  // both 32-bit numbers, so the shorthand that takes one of them says which.)
  bool createDirectoryAtURL(const std::string& url, bool withIntermediateDirectories, mode_t mode, QRVError* error);
  bool createDirectoryAtURLWithClass(const std::string& url, bool withIntermediateDirectories, mode_t mode,
                                     uint32_t protectionClass, QRVError* error);
  bool createDirectoryAtURLWithOwner(const std::string& url, bool withIntermediateDirectories, mode_t mode, uid_t owner,
                                     QRVError* error);

  // Creates the relative path `relative` (no "." or "..") below the
  // directory `base` as createDirectoryAtURL does with intermediate
  // directories, but walks from `base` one component at a time without
  // following links: for directories inside a container, whose user may have
  // put links anywhere. A link or a non-directory on the way fails with
  // EEXIST (a link as `base` itself with ELOOP or ENOTDIR).
  bool createDirectoryBelowURL(const std::string& base, const std::string& relative, mode_t mode, uid_t owner,
                               uint32_t protectionClass, QRVError* error);

  // Creates a new directory (mode 0700) named `prefix` + six random
  // characters inside `directory` and returns its path. The first form uses
  // the prefix "temp.".
  std::optional<std::string> createTemporaryDirectoryInDirectoryURL(const std::string& directory, QRVError* error);
  std::optional<std::string> createTemporaryDirectoryInDirectoryURL(const std::string& directory,
                                                                    const std::string& withNamePrefix, QRVError* error);

  // ---- Move, copy, remove ----

  // rename(2), flushed to disk with the directory that received the item. A
  // move to another file system copies (see copyItemAtURL), flushes the copy,
  // then removes the source; failing to remove the source is only logged.
  // The "IfExists" forms succeed without doing anything when the source does
  // not exist; the plain forms then fail with ENOENT.
  bool moveItemAtURL(const std::string& url, const std::string& toURL, QRVError* error);
  bool moveItemIfExistsAtURL(const std::string& url, const std::string& toURL, QRVError* error);
  // Copies an item (a directory recursively) with all its metadata, never
  // following links on either side and cloning data where the file system
  // can. The destination must not exist (EEXIST).
  bool copyItemAtURL(const std::string& url, const std::string& toURL, QRVError* error);
  bool copyItemIfExistsAtURL(const std::string& url, const std::string& toURL, QRVError* error);

  // Removes `url` and everything below it. Entries that cannot be removed
  // because they (or their directory) are immutable have the flag cleared and
  // are removed. A path that does not exist is success. The first error that
  // remains fails the removal once the rest has been removed. An empty path
  // fails with code 14 of the daemon's domain.
  bool removeItemAtURL(const std::string& url, QRVError* error);
  // fsync(2) of the directory `url`: the entries made in it are on disk.
  bool synchronizeDirectoryAtURL(const std::string& url, QRVError* error);
  // Removes the directory `url` when it holds nothing but (empty)
  // directories, deepest first; anything else below it fails the removal
  // with ENOTEMPTY before anything is removed. A missing `url` is success.
  bool removeEmptyDirectoryTreeAtURL(const std::string& url, QRVError* error);

  // ---- Data-protection classes ----

  // Sets the class of the one item `url` (a link is never followed: opening
  // it fails). With `ifPredicate`, the current class is read first and
  // nothing changes (success) unless the predicate says so. Fails with EPERM
  // while the device is locked.
  bool setDataProtectionClassOfItemAtURL(const std::string& url, uint32_t toClass,
                                         const std::function<bool(uint32_t currentClass)>& ifPredicate,
                                         QRVError* error);
  bool dataProtectionClassOfItemAtURL(const std::string& url, uint32_t* protectionClass, QRVError* error);
  // The same on the item open at `fd` (a walk's entry); `path` only words
  // errors and log lines.
  bool setDataProtectionClassOfOpenItem(int fd, std::string_view path, uint32_t toClass,
                                        const std::function<bool(uint32_t currentClass)>& ifPredicate, QRVError* error);

  // ---- Ownership and ACLs ----

  // Gives every entry of the tree at `url` (except metadata files) the owner
  // uid:gid and mode 0755 (directories and anything executable) or 0644.
  // Failures on single entries are logged and the walk goes on.
  bool standardizeOwnershipAtURL(const std::string& url, uid_t toUID, gid_t GID, QRVError* error);

  // Puts the system-container ACLs on the tree at `url`: every entry except
  // metadata files gets mode 0, owner and group kSystemContainerOwner, then
  // the directory or file ACL for the group "systemusers". With
  // `isSystemContainer` the starting directory instead gets the top-level ACL
  // and nothing else. Failures on single entries are logged.
  bool standardizeACLsAtURL(const std::string& url, bool isSystemContainer, QRVError* error);
  bool standardizeACLsForSystemContainerAtURL(const std::string& url, QRVError* error);
  // Runs the system-container standardisation on every item of the directory
  // `url`; failures of single containers are logged.
  bool standardizeAllSystemContainerACLsAtURL(const std::string& url, QRVError* error);
  // Sets the top-level ACL on the one directory `url`.
  bool setTopLevelSystemContainerACLAtURL(const std::string& url, QRVError* error);

  using ACL = std::vector<QRVFileSystemExtras::GroupACE>;

  // ---- Sizes, debugging, homes ----

  // Allocated bytes of the whole tree at `url`, or nothing when the tree
  // could not be measured (a partial count would be a wrong answer, and 0 a
  // plausible one). The error is in the POSIX domain.
  std::optional<uint64_t> diskUsageForURL(const std::string& url, QRVError* error);
  // The same from statistics the file system maintains, turning them on for
  // the directory the first time they are missing, when the feature flag
  // "fast_container_sizing" of "quorvad" is on; otherwise, and whenever the
  // fast answer fails, diskUsageForURL.
  std::optional<uint64_t> fastDiskUsageForURL(const std::string& url, QRVError* error);

  // Logs the tree at `url`, one line per entry.
  void printDirectoryStructureAtURL(const std::string& url);

  // The real path of the home directory (under the root) of `uid`, or
  // "/private/var/mobile" under the root when there is none.
  std::string homeDirectoryURLForPOSIXUID(uid_t uid);

  // ---- Whole files ----

  // Reads a whole file. Fails with the errno of the failing call.
  bool readFileAtURL(const std::string& path, std::vector<uint8_t>* contents, QRVError* error);
  // Replaces `path` with `contents`: written to a temporary file beside it,
  // flushed to disk, renamed over the target, and the directory flushed, so
  // that after a crash the file holds either the old or the new contents.
  bool writeFileAtomically(const std::string& path, const std::vector<uint8_t>& contents, mode_t mode, QRVError* error);
  // Removes a file; a missing file is success.
  bool removeFileAtURL(const std::string& path, QRVError* error);
  // Reads a file that someone else may have planted, without trusting it:
  // neither the file nor the directory holding it may be a symbolic link
  // (ELOOP), anything but a regular file is refused without blocking on it
  // (a fifo or a device: EINVAL), and a file larger than `maxLength` bytes
  // fails with EFBIG instead of filling memory. Refusals are not logged.
  bool readRegularFileAtURL(const std::string& path, size_t maxLength, std::vector<uint8_t>* contents, QRVError* error);
  // readRegularFileAtURL of `name` inside `child`, an entry of the open
  // `directory`, with the same errors, the same refusals and no link
  // followed in either component: usually a single openat2(2) below the
  // descriptor. When that call fails it is not trusted to say which
  // component failed, and the two components are opened one at a time for
  // the answer, except when the process is out of descriptors or memory
  // (EMFILE, ENFILE, ENOMEM), which fails at once with that errno.
  bool readRegularFileBelowDirectory(const QRVOpenDirectory& directory, const std::string& child,
                                     const std::string& name, size_t maxLength, std::vector<uint8_t>* contents,
                                     QRVError* error);
  // Writes `contents` as a new file at `path` with `mode` and flushes it to
  // disk. Whatever was at `path` is removed first, so a link or hard link
  // planted there is never written through. Not atomic: for a temporary file
  // that is renamed into place afterwards.
  bool writeFileAtURL(const std::string& path, const std::vector<uint8_t>& contents, mode_t mode, QRVError* error);

  // ---- For tests only ----

  static bool TEST_validateSymlink(const std::string& path, int64_t startingDepth, int64_t* endingDepth) {
    return _validateSymlink(path, startingDepth, endingDepth);
  }
  bool TEST_traverseDirectory(const std::string& url, QRVError* error, const TraversalBlock& block) {
    return _traverseDirectory(url, error, block);
  }

 private:
  // Depth walk over `path`'s components starting at `startingDepth`: ".."
  // subtracts one, "", "." and "/" nothing, any other component adds one.
  // False as soon as the depth drops below the start; otherwise true with the
  // final depth stored through `endingDepth` (when not null).
  static bool _validateSymlink(const std::string& path, int64_t startingDepth, int64_t* endingDepth);

  // Walks `url` and everything below it in pre-order (directories also once
  // more after their contents), never following links or leaving the file
  // system: a directory on another device is delivered before and after, but
  // not entered. The entries of a directory are all examined (lstat) when the
  // walk enters it, before the first of them is delivered. A directory whose
  // contents cannot be read is delivered as kUnreadableDirectory instead of
  // its post-order visit; an entry that cannot be examined ends the walk with
  // its errno. Sibling order is the file system's.
  bool _traverseDirectory(const std::string& url, QRVError* error, const TraversalBlock& block);

  // The ACLs themselves (for the group "systemusers", which must exist).
  std::optional<ACL> _CopyTopLevelSystemContainerACLWithError(QRVError* error);
  std::optional<ACL> _CopySystemContainerACLWithNumACEs(int numACEs, bool isDir, bool inheritOnly, QRVError* error);
  bool _CreateSystemUserACEInACL(ACL* acl, uint32_t withPermissions, uint32_t andFlags, QRVError* error);

  bool _moveItemAtURL(const std::string& url, const std::string& toURL, bool failIfSrcMissing, QRVError* error);
  bool _copyItemAtURL(const std::string& url, const std::string& toURL, bool failIfSrcMissing, QRVError* error);
  // True when the source check lets the operation go on; false with
  // `*done` set when a missing source ends it successfully.
  bool _checkSource(const std::string& url, bool failIfSrcMissing, bool* done, QRVError* error);
  std::optional<std::string> _realPathForURL(const std::string& url, bool allowNonExistentPathComponents);
  std::optional<std::string> _realPathWhatExistsInPath(const std::string& path);
  bool _removalError(const QRVFileSystemExtras::RemovalFailure& failure);
  bool _clearImmutableAndRemove(int directoryFD, const char* name, const std::string& path, bool isDirectory);
  std::optional<gid_t> _systemUsersGroup(QRVError* error);
  std::string _underRoot(const std::string& path) const;
  bool _setClassAndOwnerOfDirectory(int fd, const std::string& url, uid_t owner, uint32_t protectionClass,
                                    QRVError* error);

  // Helpers over the seam that several concerns share.
  int _open(const std::string& path, int flags, int* fd);
  int _openDirectoryNoFollow(int directoryFD, const std::string& path, int* fd);
  int _lstat(const std::string& path, struct stat* st);
  int _syncDirectory(const std::string& directory);
  int _writeAll(int fd, const std::vector<uint8_t>& bytes);
  int _readAll(int fd, size_t maxLength, std::vector<uint8_t>* contents);
  // The regular file `name` in the open directory `directoryFD`, read whole
  // as readRegularFileAtURL does; `path` words the errors.
  bool _readRegularFileInDirectory(int directoryFD, const std::string& name, const std::string& path,
                                   size_t maxLength, std::vector<uint8_t>* contents, QRVError* error);
  // Reads and closes `fd`, which must be a regular file of at most
  // `maxLength` bytes.
  bool _readOpenRegularFile(int fd, const std::string& path, size_t maxLength, std::vector<uint8_t>* contents,
                            QRVError* error);
  void _close(int fd);
  void _standardizeMode(const std::string& path, const struct stat& st);
  // The rest of makeDirectory/makePath for createDirectoryAtURL.
  int _makeDirectory(const std::string& path, mode_t mode, bool* created, int* fd);
  int _makePath(const std::string& path, mode_t mode, bool* created, int* fd);
  struct Walk;
  struct DescriptorWalk;
  bool _walk(Walk* walk, const std::string& path, int level, const struct stat& st);

  const std::string root_;
  const std::shared_ptr<QRVFileSystem> files_;
  const std::shared_ptr<QRVFileSystemExtras> extras_;
  const std::shared_ptr<QRVAccounts> accounts_;
  const std::shared_ptr<QRVFeatureFlags> featureFlags_;
};

// The file manager on real directories under a temporary root, over the Linux
// file-system extras (wrapped so that single calls can be made to fail).
#include "fs/QRVFileManager.h"

#include <acl/libacl.h>
#include <fcntl.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>

#include "platform/fake/QRVFakeFileSystemExtras.h"
#include "platform/fake/QRVFakePlatform.h"
#include "platform/fake/QRVFaultInjectionFileSystem.h"
#include "platform/linux/QRVLinuxFileSystem.h"
#include "platform/linux/QRVLinuxFileSystemExtras.h"
#include "support/QRVTestServices.h"

namespace {

namespace fs = std::filesystem;
using Op = QRVFakeFileSystemExtras::Operation;
constexpr gid_t kSystemUsers = 95;
const std::string kMetadata = QRVFileManager::kMetadataFileName;

std::string realPath(const std::string& path) {
  char buffer[PATH_MAX];
  return realpath(path.c_str(), buffer) ? buffer : "";
}

struct stat lstatOf(const std::string& path) {
  struct stat st = {};
  lstat(path.c_str(), &st);
  return st;
}

// The rights of the named-group entry for `group` in one ACL, as "rwx" text;
// "none" when there is no such entry.
std::string aclEntry(const std::string& path, acl_type_t type, gid_t group) {
  acl_t acl = acl_get_file(path.c_str(), type);
  char* text = acl ? acl_to_any_text(acl, nullptr, ',', TEXT_ABBREVIATE | TEXT_NUMERIC_IDS) : nullptr;
  const std::string entries = "," + std::string(text ? text : "") + ",", key = ",g:" + std::to_string(group) + ":";
  acl_free(text);
  acl_free(acl);
  size_t found = entries.find(key);
  return found == std::string::npos ? "none" : entries.substr(found + key.size(), 3);
}

class FileManagerTest : public testing::Test {
 protected:
  FileManagerTest() {
    accounts->groups = {{"systemusers", kSystemUsers}};
    if (geteuid() != 0) fileSystem->setInMemoryProtectionClasses(true);
    // Without root, owners given are recorded by the wrapper instead of made.
    files->setRecordOwnership(geteuid() != 0);
  }
  // The status of `path` itself as the file manager sees it, owners included.
  struct stat ownerOf(const std::string& path) {
    struct stat st = {};
    files->status(AT_FDCWD, path, &st, AT_SYMLINK_NOFOLLOW);
    return st;
  }
  std::string at(const std::string& relative) const { return root.path() + "/" + relative; }
  void makeDirectories(const std::string& relative) { fs::create_directories(at(relative)); }
  void write(const std::string& relative, const std::string& contents = "x") {
    std::ofstream(at(relative)) << contents;
  }
  void link(const std::string& target, const std::string& relative) {
    ASSERT_EQ(symlink(target.c_str(), at(relative).c_str()), 0) << relative;
  }
  // Sets the immutable flag through the real extras; false when this file
  // system or user cannot.
  bool makeImmutable(const std::string& relative, bool immutable = true) {
    int fd = open(at(relative).c_str(), O_RDONLY | O_NOFOLLOW);
    int e = fd < 0 ? errno : real->setImmutableFlag(fd, immutable);
    if (fd >= 0) close(fd);
    return e == 0;
  }

  QRVTemporaryDirectory root;
  QRVError error;
  std::shared_ptr<QRVFakeLockStateService> lockState = std::make_shared<QRVFakeLockStateService>();
  std::shared_ptr<QRVLinuxFileSystemExtras> real = std::make_shared<QRVLinuxFileSystemExtras>(lockState);
  std::shared_ptr<QRVFakeFileSystemExtras> fileSystem = std::make_shared<QRVFakeFileSystemExtras>(real, lockState);
  std::shared_ptr<QRVFakeAccounts> accounts = std::make_shared<QRVFakeAccounts>();
  std::shared_ptr<QRVFakeFeatureFlags> flags = std::make_shared<QRVFakeFeatureFlags>();
  std::shared_ptr<QRVFaultInjectionFileSystem> files =
      std::make_shared<QRVFaultInjectionFileSystem>(std::make_shared<QRVLinuxFileSystem>());
  QRVFileManager fm{root.path(), files, fileSystem, accounts, flags};

  // The errno a call that took `&error` failed with (-1 for an error of
  // another domain, or none); 0 when it succeeded. Clears the error, so that
  // no result is read from an earlier call.
  int failed(bool ok) {
    int e = ok ? 0 : error.isPOSIX() ? static_cast<int>(error.code()) : -1;
    error = QRVError();
    return e;
  }
};

// ---- Path containment ----

TEST(FileManagerDepthWalkTest, CountsComponentsAndFailsOnlyBelowTheStart) {
  struct {
    const char* path;
    int64_t start;
    bool ok;
    int64_t end;  // 0 where the walk fails
  } cases[] = {{"/a/b", 0, true, 2},     {"/a/../b", 2, true, 3},      {"a/..", 0, true, 0},
               {"a/../..", 0, false, 0}, {"../x", 3, false, 0},        {"/././/", 1, true, 1},
               {"", 5, true, 5},         {"/a/b/../../c", 1, true, 2}, {"/x/../../y", 4, false, 0}};
  for (const auto& c : cases) {
    int64_t end = -99;
    bool ok = QRVFileManager::TEST_validateSymlink(c.path, c.start, &end);
    EXPECT_EQ(std::pair(ok, ok ? end : 0), std::pair(c.ok, c.end)) << c.path;
  }
}

class FileManagerPathContainmentTest : public FileManagerTest {
 protected:
  void SetUp() override {
    makeDirectories("base/a/b");
    makeDirectories("base2");
    makeDirectories("outside");
    write("base/file");
    write("base2/x");
    write("outside/secret");
    link("../../../outside", "base/a/escape");  // climbs out of the base
    link("../file", "base/a/sibling");          // stays inside
    link("..", "base/a/back");                  // climbs back exactly to the base
    link(at("base/file"), "base/abs");          // absolute, even though it points inside
    link("../hop", "base/a/chain");             // inside, but the next link leads out
    link("../outside", "base/hop");
    link("../outside", "base/outdir");  // a directory link used in the middle of a path
    link("d2", "base/d1");              // dangling chain ending outside
    link("../outside/new", "base/d2");
    link("loop", "base/loop");
    link("../base/file", "base/direct");  // out of the base and back in: refused by the depth walk
    link("base", "baselink");
    realBase = realPath(at("base"));
  }
  std::optional<std::string> resolve(const std::string& suspicious, const std::string& base = "base") {
    return fm.realPathForURL(at(suspicious), at(base));
  }
  std::string realBase;
};

TEST_F(FileManagerPathContainmentTest, EscapeAttemptsAreRefused) {
  for (const char* p : {"base/a/escape", "base/a/escape/secret", "base/abs", "base/a/chain", "base/outdir/secret",
                        "base/outdir", "base/d1", "base/d1/child", "base/loop", "base/direct", "base/a/../a", "base/..",
                        "base/a/b/../../../outside", "outside/secret", "base2/x", "base2"}) {
    EXPECT_EQ(resolve(p), std::nullopt) << p;
  }
  EXPECT_EQ(fm.realPathForURL("", at("base")), std::nullopt);
  EXPECT_EQ(fm.realPathForURL(at("base/file"), ""), std::nullopt);
  // A base that is "/" leaves nothing to compare.
  EXPECT_EQ(fm.realPathForURL(at("base/file"), "/"), std::nullopt);
}

TEST_F(FileManagerPathContainmentTest, LegitimatePathsResolveInsideTheBase) {
  EXPECT_EQ(resolve("base"), realBase);
  EXPECT_EQ(resolve("base/a/b/"), realBase + "/a/b");
  EXPECT_EQ(resolve("base/a/sibling"), realBase + "/file");
  EXPECT_EQ(resolve("base/a/back"), realBase);
  // Not yet existing components are appended to what exists.
  EXPECT_EQ(resolve("base/a/new/deeper"), realBase + "/a/new/deeper");
  // The base may itself be reached through a link.
  EXPECT_EQ(resolve("baselink/a/b", "baselink"), realBase + "/a/b");
  // "/private" in front names the same place.
  EXPECT_EQ(fm.realPathForURL("/private" + at("base/a/b"), at("base")), realBase + "/a/b");
  for (const std::string name : {"sp ace", "new\nline", "{}%s%@", "\xc3\xbcn\xc3\xaf", "..foo", "...", "-rf"}) {
    write("base/a/" + name);
    EXPECT_EQ(resolve("base/a/" + name), realBase + "/a/" + name) << name;
    EXPECT_EQ(resolve("base/a/b/" + name), realBase + "/a/b/" + name) << name;  // not there yet
  }
}

// ---- Existence, listing, traversal ----

TEST_F(FileManagerTest, ExistenceIsDecidedByLstatAndListingKeepsVisibleDirectoriesFilesAndLinks) {
  makeDirectories("d/sub");
  write("d/b-file");
  write("d/.hidden");
  link("b-file", "d/a-link");
  link("missing", "d/dangling");
  ASSERT_EQ(mkfifo(at("d/fifo").c_str(), 0600), 0);
  EXPECT_TRUE(fm.itemExistsAtURL(at("d/dangling")));
  EXPECT_FALSE(fm.itemDoesNotExistAtURL(at("d/dangling")));
  EXPECT_TRUE(fm.itemDoesNotExistAtURL(at("missing")));
  EXPECT_FALSE(fm.itemExistsAtURL(at("missing")));
  // Neither is true when lstat fails for another reason.
  EXPECT_FALSE(fm.itemExistsAtURL(at("d/b-file/child")));
  EXPECT_FALSE(fm.itemDoesNotExistAtURL(at("d/b-file/child")));

  EXPECT_EQ(fm.urlsForItemsInDirectoryAtURL(at("d"), &error),
            (std::vector<std::string>{at("d/a-link"), at("d/b-file"), at("d/dangling"), at("d/sub")}));
  EXPECT_EQ(failed(fm.urlsForItemsInDirectoryAtURL(at("missing"), &error).has_value()), ENOENT);
  EXPECT_EQ(failed(fm.urlsForItemsInDirectoryAtURL(at("d/b-file"), &error).has_value()), ENOTDIR);
}

TEST_F(FileManagerTest, TraversalVisitsDirectoriesBeforeAndAfterAndNeverFollowsLinks) {
  makeDirectories("t/c");
  write("t/c/d");
  link("c", "t/l");
  std::vector<std::string> seen;
  ASSERT_TRUE(fm.TEST_traverseDirectory(at("t"), &error, [&](const QRVDirectoryEntry& e, QRVError*) {
    using K = QRVDirectoryEntry::Kind;
    const char* kind = e.kind == K::kDirectory            ? "D"
                       : e.kind == K::kDirectoryPostOrder ? "P"
                       : e.kind == K::kSymbolicLink       ? "L"
                                                          : "F";
    seen.push_back(kind + std::to_string(e.level) + ":" + std::string(e.path).substr(root.path().size() + 1));
    return true;
  }));
  auto index = [&](const std::string& s) { return std::find(seen.begin(), seen.end(), s) - seen.begin(); };
  EXPECT_LT(index("D1:t/c"), index("F2:t/c/d"));
  EXPECT_LT(index("F2:t/c/d"), index("P1:t/c"));
  std::sort(seen.begin() + 1, seen.end() - 1);  // sibling order is the file system's
  EXPECT_EQ(seen, (std::vector<std::string>{"D0:t", "D1:t/c", "F2:t/c/d", "L1:t/l", "P1:t/c", "P0:t"}));

  // The block ends the walk, and its error becomes the walk's.
  int visited = 0;
  EXPECT_EQ(failed(fm.TEST_traverseDirectory(at("t"), &error,
                                             [&](const QRVDirectoryEntry&, QRVError* e) {
                                               *e = QRV_POSIX_ERROR_QUIET(ECANCELED, "stopped");
                                               return ++visited < 2;
                                             })),
            ECANCELED);
  EXPECT_EQ(visited, 2);
  EXPECT_EQ(failed(fm.TEST_traverseDirectory(at("missing"), &error, [](auto&, QRVError*) { return true; })), ENOENT);
}

// ---- Creation ----

TEST_F(FileManagerTest, DirectoriesGetExactModeOwnerAsGroupAndClassAndFailuresCarryTheErrno) {
  mode_t old = umask(077);
  EXPECT_TRUE(fm.createDirectoryAtURL(at("m/n/o"), true, 0751, &error));
  umask(old);
  EXPECT_EQ(lstatOf(at("m/n/o")).st_mode & 07777, 0751u);
  EXPECT_EQ(lstatOf(at("m")).st_mode & 07777, 0751u);
  // Over a path that is all there, and one whose middle is missing: what was
  // there keeps its mode, what is new gets the one asked for.
  ASSERT_EQ(mkdir(at("p").c_str(), 0755), 0);
  EXPECT_TRUE(fm.createDirectoryAtURL(at("p"), true, 0700, &error));
  EXPECT_TRUE(fm.createDirectoryAtURL(at("p/q/r"), true, 0750, &error));
  EXPECT_EQ(lstatOf(at("p")).st_mode & 07777, 0755u);
  EXPECT_EQ(lstatOf(at("p/q")).st_mode & 07777, 0750u);
  EXPECT_EQ(lstatOf(at("p/q/r")).st_mode & 07777, 0750u);
  ASSERT_TRUE(fm.createDirectoryAtURLWithOwner(at("p/q/r"), true, 0700, 1000, &error));
  EXPECT_EQ(lstatOf(at("p/q/r")).st_mode & 07777, 0750u);
  EXPECT_EQ(ownerOf(at("p/q/r")).st_uid, 1000u);
  ASSERT_TRUE(fm.createDirectoryAtURLWithOwner(at("owned"), false, 0755, 1000, &error));
  EXPECT_EQ(ownerOf(at("owned")).st_uid, 1000u);
  EXPECT_EQ(ownerOf(at("owned")).st_gid, 1000u);
  // An existing directory is success, treated as new for class and owner;
  // its mode stays.
  ASSERT_TRUE(fm.createDirectoryAtURLWithClass(at("m/n/o"), false, 0700, 2, &error));
  EXPECT_EQ(lstatOf(at("m/n/o")).st_mode & 07777, 0751u);
  uint32_t cls = 0;
  ASSERT_TRUE(fm.dataProtectionClassOfItemAtURL(at("m/n/o"), &cls, &error));
  EXPECT_EQ(cls, 2u);

  // A link where a directory stood (a container's user may plant one) is
  // neither given away nor classed through: what it points to is not ours.
  ASSERT_EQ(mkdir(at("target").c_str(), 0755), 0);
  ASSERT_EQ(symlink(at("target").c_str(), at("planted").c_str()), 0);
  EXPECT_NE(failed(fm.createDirectoryAtURL(at("planted"), false, 0755, 1000, 2, &error)), 0u);
  EXPECT_EQ(ownerOf(at("target")).st_uid, geteuid());
  ASSERT_TRUE(fm.dataProtectionClassOfItemAtURL(at("target"), &cls, &error));
  EXPECT_NE(cls, 2u);

  // Below a container the walk takes no link at any depth, and never climbs.
  ASSERT_EQ(mkdir(at("box").c_str(), 0755), 0);
  ASSERT_EQ(symlink(at("target").c_str(), at("box/Library").c_str()), 0);
  EXPECT_EQ(failed(fm.createDirectoryBelowURL(at("box"), "Library/Caches", 0755, 0,
                                              QRVFileManager::kLeaveProtectionClassAlone, &error)),
            EEXIST);
  EXPECT_FALSE(std::filesystem::exists(at("target/Caches")));
  for (const char* climbing : {"../out", "/out", "./out", "a/../../out", ""})
    EXPECT_EQ(failed(fm.createDirectoryBelowURL(at("box"), climbing, 0755, 0,
                                                QRVFileManager::kLeaveProtectionClassAlone, &error)),
              EINVAL)
        << climbing;
  ASSERT_TRUE(fm.createDirectoryBelowURL(at("box"), "Documents/Inbox", 0751, 1000, 2, &error));
  EXPECT_EQ(lstatOf(at("box/Documents")).st_mode & 07777, 0751u);
  EXPECT_EQ(lstatOf(at("box/Documents/Inbox")).st_mode & 07777, 0751u);
  EXPECT_EQ(ownerOf(at("box/Documents/Inbox")).st_uid, 1000u);
  ASSERT_TRUE(fm.dataProtectionClassOfItemAtURL(at("box/Documents/Inbox"), &cls, &error));
  EXPECT_EQ(cls, 2u);

  write("file");
  EXPECT_EQ(failed(fm.createDirectoryAtURL(at("file"), false, 0755, &error)), EEXIST);
  EXPECT_EQ(failed(fm.createDirectoryAtURL(at("no/parent"), false, 0755, &error)), ENOENT);
  EXPECT_EQ(failed(fm.createDirectoryAtURL(at("file/below"), true, 0755, &error)), ENOTDIR);
  lockState->state = 1;  // classes cannot change while locked
  EXPECT_EQ(failed(fm.createDirectoryAtURL(at("locked"), false, 0755, 0, 1, &error)), EPERM);
}

// Failures halfway through, injected into single calls of the file system.
TEST_F(FileManagerTest, FailuresHalfwayLeaveTheOldStateAndNoLeftovers) {
  using FOp = QRVFaultInjectionFileSystem::Operation;
  const std::vector<uint8_t> oldBytes{'o', 'l', 'd'}, newBytes{'n', 'e', 'w'};
  ASSERT_TRUE(fm.writeFileAtomically(at("f"), oldBytes, 0644, &error));
  // An atomic write that cannot be flushed, or renamed into place, keeps the
  // old contents and removes its temporary file.
  for (FOp op : {FOp::kSynchronize, FOp::kRename}) {
    files->failNext(op, EIO, at("f.tmp-"));
    EXPECT_EQ(failed(fm.writeFileAtomically(at("f"), newBytes, 0644, &error)), EIO);
    std::vector<uint8_t> read;
    ASSERT_TRUE(fm.readFileAtURL(at("f"), &read, &error));
    EXPECT_EQ(read, oldBytes);
    EXPECT_EQ(std::distance(fs::directory_iterator(root.path()), fs::directory_iterator()), 1);
  }
  // A plain write that fails removes what it began; a failing read says so.
  files->failNext(FOp::kWrite, ENOSPC, at("g"));
  EXPECT_EQ(failed(fm.writeFileAtURL(at("g"), newBytes, 0600, &error)), ENOSPC);
  EXPECT_FALSE(fs::exists(at("g")));
  std::vector<uint8_t> read;
  files->failNext(FOp::kRead, EIO, at("f"));
  EXPECT_EQ(failed(fm.readFileAtURL(at("f"), &read, &error)), EIO);

  // A directory whose contents cannot be read is delivered as such, without
  // a post-order visit, and the walk goes on with its siblings.
  makeDirectories("w/locked/inner");
  makeDirectories("w/open");
  files->failNext(FOp::kReadDirectory, EACCES, at("w/locked"));
  std::vector<std::string> seen;
  ASSERT_TRUE(fm.TEST_traverseDirectory(at("w"), &error, [&](const QRVDirectoryEntry& e, QRVError*) {
    using K = QRVDirectoryEntry::Kind;
    std::string name = std::string(e.path).substr(root.path().size() + 1);
    if (e.kind == K::kUnreadableDirectory) name = "unreadable " + name + " " + std::to_string(e.errnum);
    if (e.kind == K::kDirectoryPostOrder) name = "after " + name;
    seen.push_back(name);
    return true;
  }));
  std::sort(seen.begin(), seen.end());
  EXPECT_EQ(seen, (std::vector<std::string>{"after w", "after w/open", "unreadable w/locked " + std::to_string(EACCES),
                                            "w", "w/locked", "w/open"}));
  // An entry that cannot be examined ends the walk with its errno.
  files->inject(FOp::kStatus, {.errnum = EIO, .pathContains = at("w/open")});
  EXPECT_EQ(failed(fm.TEST_traverseDirectory(at("w"), &error, [](auto&, QRVError*) { return true; })), EIO);
}

TEST_F(FileManagerTest, TemporaryDirectoriesAreUniqueAndPrivate) {
  auto a = fm.createTemporaryDirectoryInDirectoryURL(root.path(), &error);
  auto b = fm.createTemporaryDirectoryInDirectoryURL(root.path() + "/", "com.kelva.UserManagedAssets.", &error);
  ASSERT_TRUE(a && b);
  EXPECT_EQ(a->rfind(at("temp."), 0), 0u);
  EXPECT_EQ(a->size(), at("temp.").size() + 6);
  EXPECT_EQ(b->rfind(at("com.kelva.UserManagedAssets."), 0), 0u);
  EXPECT_EQ(lstatOf(*a).st_mode & 07777, 0700u);
  EXPECT_EQ(failed(fm.createTemporaryDirectoryInDirectoryURL(at("missing"), &error).has_value()), ENOENT);
}

// ---- Move and copy ----

TEST_F(FileManagerTest, MoveRenamesAndTreatsAMissingSourceByForm) {
  makeDirectories("src/inner");
  write("src/inner/f", "data");
  ASSERT_TRUE(fm.moveItemAtURL(at("src"), at("dst"), &error));
  EXPECT_FALSE(fs::exists(at("src")));
  EXPECT_TRUE(fs::exists(at("dst/inner/f")));

  EXPECT_TRUE(fm.moveItemIfExistsAtURL(at("src"), at("elsewhere"), &error));
  EXPECT_TRUE(fm.copyItemIfExistsAtURL(at("src"), at("elsewhere"), &error));
  EXPECT_FALSE(fs::exists(at("elsewhere")));
  EXPECT_EQ(failed(fm.moveItemAtURL(at("src"), at("elsewhere"), &error)), ENOENT);
  EXPECT_EQ(failed(fm.copyItemAtURL(at("src"), at("elsewhere"), &error)), ENOENT);

  ASSERT_TRUE(fm.copyItemAtURL(at("dst"), at("copy"), &error));
  EXPECT_TRUE(fs::exists(at("copy/inner/f")));
  EXPECT_EQ(failed(fm.copyItemAtURL(at("dst"), at("copy"), &error)), EEXIST);
}

TEST_F(FileManagerTest, MoveToAnotherFileSystemCopiesThenRemovesTheSource) {
  std::string other = "/dev/shm/quorvad-fm-test-XXXXXX";
  struct stat shm, tmp;
  if (stat("/dev/shm", &shm) != 0 || stat(root.path().c_str(), &tmp) != 0 || shm.st_dev == tmp.st_dev ||
      !mkdtemp(other.data()))
    GTEST_SKIP() << "no second file system to move to";
  struct RemoveAtEnd {
    std::string path;
    ~RemoveAtEnd() { fs::remove_all(path); }
  } cleanUp{other};
  makeDirectories("src/inner");
  write("src/inner/f", "cross-device");
  ASSERT_EQ(chmod(at("src/inner/f").c_str(), 0604), 0);
  link("f", "src/inner/l");

  // A failed copy fails the move and keeps the source.
  fileSystem->failNext(Op::kCopyItem, ENOSPC);
  EXPECT_EQ(failed(fm.moveItemAtURL(at("src"), other + "/moved", &error)), ENOSPC);
  EXPECT_TRUE(fs::exists(at("src/inner/f")));
  // A failed removal of the source does not fail the move.
  fileSystem->failNext(Op::kRemoveTree, EIO);
  EXPECT_TRUE(fm.moveItemAtURL(at("src"), other + "/kept", &error));
  EXPECT_TRUE(fs::exists(other + "/kept/inner/f"));
  EXPECT_TRUE(fs::exists(at("src/inner/f")));

  ASSERT_TRUE(fm.moveItemAtURL(at("src"), other + "/moved", &error)) << error.description();
  EXPECT_FALSE(fs::exists(at("src")));
  std::ifstream in(other + "/moved/inner/f");
  EXPECT_EQ(std::string(std::istreambuf_iterator<char>(in), {}), "cross-device");
  EXPECT_EQ(lstatOf(other + "/moved/inner/f").st_mode & 07777, 0604u);
  EXPECT_EQ(fs::read_symlink(other + "/moved/inner/l"), "f");
}

// ---- Removal ----

TEST_F(FileManagerTest, RemovalClearsImmutableEntriesButReportsTheFirstErrorThatRemains) {
  EXPECT_TRUE(fm.removeItemAtURL(at("never-there"), &error));
  EXPECT_FALSE(fm.removeItemAtURL("", &error));
  EXPECT_EQ(error.domain(), QRVError::kDomain);
  EXPECT_EQ(error.code(), 14u);

  makeDirectories("tree/locked-dir/inner");
  makeDirectories("outside");
  write("tree/stuck");
  write("tree/locked-dir/inner/f");
  write("tree/locked-dir/g");
  write("outside/keep");
  link(at("outside"), "tree/out");
  if (!makeImmutable("tree/stuck")) GTEST_SKIP() << "this file system or user cannot set the immutable flag";
  ASSERT_TRUE(makeImmutable("tree/locked-dir"));
  EXPECT_TRUE(fm.removeItemAtURL(at("tree"), &error)) << error.description();
  EXPECT_FALSE(fs::exists(at("tree")));
  EXPECT_TRUE(fs::exists(at("outside/keep")));

  // When the flag cannot be cleared, the rest goes and the entry's error is
  // the removal's.
  makeDirectories("tree/sub");
  write("tree/sub/stuck");
  write("tree/other");
  ASSERT_TRUE(makeImmutable("tree/sub/stuck"));
  fileSystem->failNext(Op::kSetImmutableFlag, EPERM, 100);
  EXPECT_EQ(failed(fm.removeItemAtURL(at("tree"), &error)), EPERM);
  EXPECT_FALSE(fs::exists(at("tree/other")));
  makeImmutable("tree/sub/stuck", false);
  fileSystem->failNext(Op::kRemoveTree, EIO);
  EXPECT_EQ(failed(fm.removeItemAtURL(at("tree"), &error)), EIO);
  EXPECT_TRUE(fm.removeItemAtURL(at("tree"), &error));
  EXPECT_FALSE(fs::exists(at("tree")));
}

// ---- Data-protection classes ----

TEST_F(FileManagerTest, ClassGetSetWithPredicateAndLock) {
  write("file");
  uint32_t cls = 99, seen = 0;
  ASSERT_TRUE(fm.dataProtectionClassOfItemAtURL(at("file"), &cls, &error));
  EXPECT_EQ(cls, 0u);
  ASSERT_TRUE(fm.setDataProtectionClassOfItemAtURL(at("file"), 3, nullptr, &error));
  // The predicate sees the current class and may refuse the change.
  ASSERT_TRUE(fm.setDataProtectionClassOfItemAtURL(
      at("file"), 1,
      [&](uint32_t current) {
        seen = current;
        return false;
      },
      &error));
  EXPECT_EQ(seen, 3u);
  ASSERT_TRUE(fm.dataProtectionClassOfItemAtURL(at("file"), &cls, &error));
  EXPECT_EQ(cls, 3u);
  ASSERT_TRUE(fm.setDataProtectionClassOfItemAtURL(
      at("file"), 1, [](uint32_t c) { return c != 2; }, &error));
  ASSERT_TRUE(fm.dataProtectionClassOfItemAtURL(at("file"), &cls, &error));
  EXPECT_EQ(cls, 1u);

  link("file", "link");
  EXPECT_EQ(failed(fm.setDataProtectionClassOfItemAtURL(at("link"), 4, nullptr, &error)), ELOOP);
  fileSystem->failNext(Op::kProtectionClass, EIO);
  EXPECT_EQ(failed(fm.dataProtectionClassOfItemAtURL(at("file"), &cls, &error)), EIO);
  lockState->state = 1;
  EXPECT_EQ(failed(fm.setDataProtectionClassOfItemAtURL(at("file"), 4, nullptr, &error)), EPERM);
}

// ---- Ownership and ACLs ----

TEST_F(FileManagerTest, OwnershipStandardisationSetsOwnerAndModesButSkipsMetadata) {
  makeDirectories("c/dir");
  write("c/dir/tool");
  write("c/plain");
  write("c/" + kMetadata);
  link("plain", "c/link");
  chmod(at("c/dir").c_str(), 0700);
  chmod(at("c/dir/tool").c_str(), 04710);
  chmod(at("c/plain").c_str(), 0600);
  chmod(at("c/" + kMetadata).c_str(), 0600);
  ASSERT_TRUE(fm.standardizeOwnershipAtURL(at("c"), 501, 502, &error)) << error.description();
  for (const char* p : {"c", "c/dir", "c/dir/tool", "c/plain", "c/link"}) {
    EXPECT_EQ(ownerOf(at(p)).st_uid, 501u) << p;
    EXPECT_EQ(ownerOf(at(p)).st_gid, 502u) << p;
  }
  EXPECT_EQ(lstatOf(at("c/dir")).st_mode & 07777, 0755u);
  EXPECT_EQ(lstatOf(at("c/dir/tool")).st_mode & 07777, 0755u);  // set-id bits are gone
  EXPECT_EQ(lstatOf(at("c/plain")).st_mode & 07777, 0644u);
  EXPECT_EQ(ownerOf(at("c/" + kMetadata)).st_uid, geteuid());
  EXPECT_EQ(lstatOf(at("c/" + kMetadata)).st_mode & 07777, 0600u);
  EXPECT_EQ(failed(fm.standardizeOwnershipAtURL(at("missing"), 501, 501, &error)), ENOENT);
}

class FileManagerSystemContainerACLTest : public FileManagerTest {
 protected:
  void SetUp() override {
    makeDirectories("sys/c1/Library");
    makeDirectories("sys/c2");
    write("sys/c1/Library/file");
    write("sys/c1/" + kMetadata);
    link("Library/file", "sys/c1/link");
    chmod(at("sys/c1").c_str(), 0755);
    if (real->setGroupACL(at("sys/c2"), {}) != 0) GTEST_SKIP() << "this file system has no POSIX ACLs";
  }
  // Entries left with mode 0 cannot be listed by a user without root: give
  // them back to their owner so that the temporary root can be removed.
  void TearDown() override {
    if (geteuid() == 0) return;
    std::function<void(const fs::path&)> reopen = [&](const fs::path& p) {
      std::error_code ec;
      if (fs::is_symlink(fs::symlink_status(p, ec))) return;
      fs::permissions(p, fs::perms::owner_all, fs::perm_options::add, ec);
      if (!fs::is_directory(p, ec)) return;
      for (const auto& child : fs::directory_iterator(p, ec)) reopen(child.path());
    };
    reopen(at("sys"));
  }
  // Runs `action` as uid 4000 with the given supplementary groups; its exit
  // status tells whether every step succeeded. The child makes system calls
  // only: other threads may have held locks when it was forked.
  bool asOtherUser(std::vector<gid_t> groups, const std::function<bool()>& action) {
    pid_t pid = fork();
    if (pid == 0) {
      bool ok = setgroups(groups.size(), groups.data()) == 0 && setgid(4000) == 0 && setuid(4000) == 0 && action();
      _exit(ok ? 0 : 1);
    }
    int status = 0;
    waitpid(pid, &status, 0);
    return WIFEXITED(status) && WEXITSTATUS(status) == 0;
  }
};

TEST_F(FileManagerSystemContainerACLTest, EntriesBelongToNobodyWithModeZeroAndAreReachedByTheGroupACL) {
  // Directories left with mode 0 can be walked into only by root: without it
  // the walk stops at the first one, and there would be nothing to check.
  if (geteuid() != 0) GTEST_SKIP() << "needs root: walks through mode-0 directories";
  ASSERT_TRUE(fm.standardizeACLsForSystemContainerAtURL(at("sys/c1"), &error)) << error.description();
  // The container directory: top-level ACL only, owner and mode bits kept.
  EXPECT_EQ(ownerOf(at("sys/c1")).st_uid, geteuid());
  EXPECT_EQ(lstatOf(at("sys/c1")).st_mode & 0707, 0705u);
  EXPECT_EQ(aclEntry(at("sys/c1"), ACL_TYPE_ACCESS, kSystemUsers), "-wx");
  EXPECT_EQ(aclEntry(at("sys/c1"), ACL_TYPE_DEFAULT, kSystemUsers), "rwx");
  // Inside: nobody's, mode 0 apart from the ACL mask in the group bits.
  for (const char* p : {"sys/c1/Library", "sys/c1/Library/file"}) {
    struct stat st = ownerOf(at(p));
    EXPECT_EQ(st.st_uid, QRVFileManager::kSystemContainerOwner) << p;
    EXPECT_EQ(st.st_gid, QRVFileManager::kSystemContainerOwner) << p;
    EXPECT_EQ(st.st_mode & 07777, 0070u) << p;
    EXPECT_EQ(aclEntry(at(p), ACL_TYPE_ACCESS, kSystemUsers), "rwx") << p;
  }
  EXPECT_EQ(aclEntry(at("sys/c1/Library"), ACL_TYPE_DEFAULT, kSystemUsers), "rwx");
  EXPECT_EQ(aclEntry(at("sys/c1/Library/file"), ACL_TYPE_DEFAULT, kSystemUsers), "none");
  EXPECT_EQ(ownerOf(at("sys/c1/link")).st_uid, QRVFileManager::kSystemContainerOwner);
  EXPECT_EQ(ownerOf(at("sys/c1/" + kMetadata)).st_uid, geteuid());
  EXPECT_EQ(aclEntry(at("sys/c1/" + kMetadata), ACL_TYPE_ACCESS, kSystemUsers), "none");

  // A member of the group can work inside; anyone else cannot. (Taking
  // another uid needs root.)
  if (geteuid() != 0) return;
  ASSERT_EQ(chmod(root.path().c_str(), 0755), 0);
  const std::string made = at("sys/c1/Library/made-by-member"), existing = at("sys/c1/Library/file");
  auto canOpen = [](const std::string& path, int openFlags) {
    int fd = open(path.c_str(), openFlags, 0600);
    if (fd >= 0) close(fd);
    return fd >= 0;
  };
  EXPECT_TRUE(asOtherUser({kSystemUsers}, [&] {
    return canOpen(made, O_CREAT | O_WRONLY) && canOpen(made, O_RDWR) && canOpen(existing, O_RDWR);
  }));
  EXPECT_FALSE(asOtherUser({}, [&] { return canOpen(existing, O_RDONLY); }));
}

TEST_F(FileManagerSystemContainerACLTest, VariantsAndFailures) {
  // Not a system container: the starting directory is treated like the rest.
  ASSERT_TRUE(fm.standardizeACLsAtURL(at("sys/c2"), false, &error));
  EXPECT_EQ(ownerOf(at("sys/c2")).st_uid, QRVFileManager::kSystemContainerOwner);
  EXPECT_EQ(aclEntry(at("sys/c2"), ACL_TYPE_ACCESS, kSystemUsers), "rwx");

  ASSERT_TRUE(fm.standardizeAllSystemContainerACLsAtURL(at("sys"), &error));
  EXPECT_EQ(aclEntry(at("sys/c1"), ACL_TYPE_ACCESS, kSystemUsers), "-wx");
  EXPECT_EQ(aclEntry(at("sys/c2"), ACL_TYPE_ACCESS, kSystemUsers), "-wx");
  EXPECT_EQ(failed(fm.standardizeAllSystemContainerACLsAtURL(at("missing"), &error)), ENOENT);
  EXPECT_EQ(failed(fm.setTopLevelSystemContainerACLAtURL(at("sys/c1/link"), &error)), EOPNOTSUPP);
  accounts->groups.clear();
  EXPECT_EQ(failed(fm.standardizeACLsForSystemContainerAtURL(at("sys/c1"), &error)), ENOENT);  // the group's
}

// ---- Sizes, homes ----

TEST_F(FileManagerTest, DiskUsageTakesTheFastPathOnlyWhenEnabledAndFallsBack) {
  using Mode = QRVFileSystemExtras::StatisticsMode;
  makeDirectories("c");
  fileSystem->setStatisticsOverride(Mode::kComprehensive, {1000, 2});
  fileSystem->setStatisticsOverride(Mode::kFastOnly, {2000, 2});
  EXPECT_EQ(fm.diskUsageForURL(at("c"), nullptr), 1000u);
  EXPECT_EQ(fm.fastDiskUsageForURL(at("c"), nullptr), 1000u);  // flag off
  EXPECT_EQ(fileSystem->statisticsModes(), (std::vector<Mode>{Mode::kComprehensive, Mode::kComprehensive}));

  flags->flags["quorvad/fast_container_sizing"] = true;
  EXPECT_EQ(fm.fastDiskUsageForURL(at("c"), nullptr), 2000u);
  // No maintained statistics yet: they are turned on and asked for again.
  fileSystem->failNext(Op::kDirectoryStatistics, ENOTSUP);
  EXPECT_EQ(fm.fastDiskUsageForURL(at("c"), nullptr), 2000u);
  EXPECT_EQ(fileSystem->calls(Op::kEnableMaintainedDirectoryStatistics), 1);
  // A nonsense or failed fast answer falls back to the walk.
  fileSystem->failNext(Op::kDirectoryStatistics, EIO);
  EXPECT_EQ(fm.fastDiskUsageForURL(at("c"), nullptr), 1000u);
  fileSystem->setStatisticsOverride(Mode::kFastOnly, {-5, 1});
  EXPECT_EQ(fm.fastDiskUsageForURL(at("c"), nullptr), 1000u);
}

// A tree that cannot be measured has no size: never 0, never a part.
TEST_F(FileManagerTest, DiskUsageThatCannotBeMeasuredIsAnError) {
  using Mode = QRVFileSystemExtras::StatisticsMode;
  makeDirectories("c");
  fileSystem->failNext(Op::kDirectoryStatistics, ENAMETOOLONG);
  EXPECT_EQ(fm.diskUsageForURL(at("c"), &error), std::nullopt);
  EXPECT_EQ(error.code(), static_cast<uint64_t>(ENAMETOOLONG));
  EXPECT_EQ(fm.diskUsageForURL("", &error), std::nullopt);
  EXPECT_EQ(error.code(), static_cast<uint64_t>(ENOENT));
  fileSystem->setStatisticsOverride(Mode::kComprehensive, {-1, 2});
  EXPECT_EQ(fm.diskUsageForURL(at("c"), &error), std::nullopt);
  EXPECT_EQ(error.code(), static_cast<uint64_t>(EOVERFLOW));

  // Fast sizing failing and its fallback failing too is a failure as well.
  flags->flags["quorvad/fast_container_sizing"] = true;
  fileSystem->failNext(Op::kDirectoryStatistics, EIO, 2);
  EXPECT_EQ(fm.fastDiskUsageForURL(at("c"), &error), std::nullopt);
  EXPECT_EQ(error.code(), static_cast<uint64_t>(EIO));
}

TEST_F(FileManagerTest, HomeDirectoriesLieUnderTheRoot) {
  makeDirectories("private/var/mobile");
  accounts->accounts = {{"mobile", 501, 501, "/private/var/mobile"}, {"ghost", 502, 502, "/private/var/ghost"}};
  EXPECT_EQ(fm.homeDirectoryURLForPOSIXUID(501), realPath(at("private/var/mobile")));
  EXPECT_EQ(fm.homeDirectoryURLForPOSIXUID(502), at("private/var/mobile"));
  EXPECT_EQ(fm.homeDirectoryURLForPOSIXUID(999), at("private/var/mobile"));
}

}  // namespace

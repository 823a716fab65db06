// The file manager on real directories under a temporary root, over the Linux
// file-system extras (wrapped so that single calls can be made to fail).
#include "QRVFileManager.h"

#include <acl/libacl.h>
#include <fcntl.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <functional>
#include <sstream>

#include "QRVLog.h"
#include "fake/QRVFakeFileSystemExtras.h"
#include "fake/QRVFakePlatform.h"
#include "linux/QRVLinuxFileSystemExtras.h"
#include "support/QRVTestServices.h"

namespace {

namespace fs = std::filesystem;
using Op = QRVFakeFileSystemExtras::Operation;
constexpr gid_t kSystemUsers = 95;

std::string realPath(const std::string& path) {
  char buffer[PATH_MAX];
  return realpath(path.c_str(), buffer) ? buffer : "";
}

struct stat lstatOf(const std::string& path) {
  struct stat st = {};
  lstat(path.c_str(), &st);
  return st;
}

std::string aclEntry(const std::string& path, acl_type_t type, gid_t group) {
  acl_t acl = acl_get_file(path.c_str(), type);
  std::string rights = "none";
  acl_entry_t entry;
  for (int r = acl ? acl_get_entry(acl, ACL_FIRST_ENTRY, &entry) : 0; r == 1;
       r = acl_get_entry(acl, ACL_NEXT_ENTRY, &entry)) {
    acl_tag_t tag;
    acl_get_tag_type(entry, &tag);
    if (tag != ACL_GROUP) continue;
    auto* gid = static_cast<gid_t*>(acl_get_qualifier(entry));
    if (*gid == group) {
      acl_permset_t p;
      acl_get_permset(entry, &p);
      rights = std::string(acl_get_perm(p, ACL_READ) ? "r" : "-") + (acl_get_perm(p, ACL_WRITE) ? "w" : "-") +
               (acl_get_perm(p, ACL_EXECUTE) ? "x" : "-");
    }
    acl_free(gid);
  }
  if (acl) acl_free(acl);
  return rights;
}

class FileManagerTest : public testing::Test {
 protected:
  FileManagerTest() {
    accounts->groups = {{"systemusers", kSystemUsers}};
    if (geteuid() != 0) fileSystem->setInMemoryProtectionClasses(true);
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
  std::shared_ptr<QRVFakeLockStateService> lockState = std::make_shared<QRVFakeLockStateService>();
  std::shared_ptr<QRVLinuxFileSystemExtras> real = std::make_shared<QRVLinuxFileSystemExtras>(lockState);
  std::shared_ptr<QRVFakeFileSystemExtras> fileSystem = std::make_shared<QRVFakeFileSystemExtras>(real, lockState);
  std::shared_ptr<QRVFakeAccounts> accounts = std::make_shared<QRVFakeAccounts>();
  std::shared_ptr<QRVFakeFeatureFlags> flags = std::make_shared<QRVFakeFeatureFlags>();
  QRVFileManager fm{root.path(), fileSystem, accounts, flags};
};

// ---- Path containment ----

TEST(FileManagerDepthWalkTest, CountsComponentsAndFailsOnlyBelowTheStart) {
  struct Case {
    const char* path;
    int64_t start;
    bool ok;
    int64_t end;
  } cases[] = {
      {"/a/b", 0, true, 2},     {"/a/../b", 2, true, 3},      {"a/..", 0, true, 0},
      {"a/../..", 0, false, 0}, {"../x", 3, false, 0},        {"/././/", 1, true, 1},
      {"", 5, true, 5},         {"/a/b/../../c", 1, true, 2}, {"/x/../../y", 4, false, 0},
  };
  for (const Case& c : cases) {
    int64_t end = -99;
    EXPECT_EQ(QRVFileManager::_validateSymlink(c.path, c.start, &end), c.ok) << c.path;
    if (c.ok) {
      EXPECT_EQ(end, c.end) << c.path;
    }
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
  EXPECT_EQ(resolve("base/a/b"), realBase + "/a/b");
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

TEST_F(FileManagerTest, ExistenceIsDecidedByLstat) {
  write("file");
  link("missing", "dangling");
  EXPECT_TRUE(fm.itemExistsAtURL(at("file")));
  EXPECT_TRUE(fm.itemExistsAtURL(at("dangling")));
  EXPECT_FALSE(fm.itemDoesNotExistAtURL(at("dangling")));
  EXPECT_TRUE(fm.itemDoesNotExistAtURL(at("missing")));
  EXPECT_FALSE(fm.itemExistsAtURL(at("missing")));
  // Neither is true when lstat fails for another reason.
  EXPECT_FALSE(fm.itemExistsAtURL(at("file/child")));
  EXPECT_FALSE(fm.itemDoesNotExistAtURL(at("file/child")));
}

TEST_F(FileManagerTest, ListingKeepsDirectoriesFilesAndLinksWithoutHiddenNames) {
  makeDirectories("d/sub");
  write("d/b-file");
  write("d/.hidden");
  link("b-file", "d/a-link");
  ASSERT_EQ(mkfifo(at("d/fifo").c_str(), 0600), 0);
  QRVError error;
  auto items = fm.urlsForItemsInDirectoryAtURL(at("d"), &error);
  ASSERT_TRUE(items);
  EXPECT_EQ(*items, (std::vector<std::string>{at("d/a-link"), at("d/b-file"), at("d/sub")}));

  EXPECT_FALSE(fm.urlsForItemsInDirectoryAtURL(at("missing"), &error));
  EXPECT_EQ(error.code(), static_cast<uint64_t>(ENOENT));
  EXPECT_TRUE(error.isPOSIX());
  EXPECT_FALSE(fm.urlsForItemsInDirectoryAtURL(at("d/b-file"), &error));
  EXPECT_EQ(error.code(), static_cast<uint64_t>(ENOTDIR));
  EXPECT_EQ(error.message(), "_IterateDirectory for " + at("d/b-file") + " returned Not a directory");
}

TEST_F(FileManagerTest, TraversalVisitsDirectoriesBeforeAndAfterAndNeverFollowsLinks) {
  makeDirectories("t/c");
  write("t/c/d");
  link("c", "t/l");
  std::vector<std::string> seen;
  QRVError error;
  ASSERT_TRUE(fm._traverseDirectory(at("t"), &error, [&](const QRVDirectoryEntry& e, QRVError*) {
    std::string rel = std::string(e.path).substr(root.path().size() + 1);
    const char* kind = e.kind == QRVDirectoryEntry::Kind::kDirectory            ? "D"
                       : e.kind == QRVDirectoryEntry::Kind::kDirectoryPostOrder ? "P"
                       : e.kind == QRVDirectoryEntry::Kind::kSymbolicLink       ? "L"
                                                                                : "F";
    seen.push_back(std::string(kind) + std::to_string(e.level) + ":" + rel);
    return true;
  }));
  auto index = [&](const std::string& s) { return std::find(seen.begin(), seen.end(), s) - seen.begin(); };
  EXPECT_LT(index("D1:t/c"), index("F2:t/c/d"));
  EXPECT_LT(index("F2:t/c/d"), index("P1:t/c"));
  std::sort(seen.begin() + 1, seen.end() - 1);  // sibling order is the file system's
  EXPECT_EQ(seen, (std::vector<std::string>{"D0:t", "D1:t/c", "F2:t/c/d", "L1:t/l", "P1:t/c", "P0:t"}));

  int visited = 0;
  EXPECT_FALSE(fm._traverseDirectory(at("t"), &error, [&](const QRVDirectoryEntry&, QRVError* e) {
    *e = QRV_POSIX_ERROR_QUIET(ECANCELED, "stopped");
    return ++visited < 2;
  }));
  EXPECT_EQ(visited, 2);
  EXPECT_EQ(error.code(), static_cast<uint64_t>(ECANCELED));

  EXPECT_FALSE(fm._traverseDirectory(at("missing"), &error, [](const QRVDirectoryEntry&, QRVError*) { return true; }));
  EXPECT_EQ(error.message(), "Error for path " + at("missing") + ": No such file or directory");
}

// ---- Creation ----

TEST_F(FileManagerTest, DirectoriesGetExactModeOwnerAsGroupAndClass) {
  mode_t old = umask(077);
  QRVError error;
  EXPECT_TRUE(fm.createDirectoryAtURL(at("m/n/o"), true, 0751, &error));
  umask(old);
  EXPECT_EQ(lstatOf(at("m/n/o")).st_mode & 07777, 0751u);
  EXPECT_EQ(lstatOf(at("m")).st_mode & 07777, 0751u);

  if (geteuid() == 0) {
    ASSERT_TRUE(fm.createDirectoryAtURLWithOwner(at("owned"), false, 0755, 1000, &error));
    EXPECT_EQ(lstatOf(at("owned")).st_uid, 1000u);
    EXPECT_EQ(lstatOf(at("owned")).st_gid, 1000u);
  }
  // An existing directory is success, treated as new for class and owner;
  // its mode stays.
  ASSERT_TRUE(fm.createDirectoryAtURLWithClass(at("m/n/o"), false, 0700, 2, &error));
  EXPECT_EQ(lstatOf(at("m/n/o")).st_mode & 07777, 0751u);
  uint32_t cls = 0;
  ASSERT_TRUE(fm.dataProtectionClassOfItemAtURL(at("m/n/o"), &cls, &error));
  EXPECT_EQ(cls, 2u);
}

TEST_F(FileManagerTest, DirectoryCreationFailuresNameTheCall) {
  write("file");
  QRVError error;
  EXPECT_FALSE(fm.createDirectoryAtURL(at("file"), false, 0755, &error));
  EXPECT_EQ(error.code(), static_cast<uint64_t>(EEXIST));
  EXPECT_EQ(error.message(), "mkdir of " + at("file") + " failed: File exists");
  EXPECT_FALSE(fm.createDirectoryAtURL(at("no/parent"), false, 0755, &error));
  EXPECT_EQ(error.message(), "mkdir of " + at("no/parent") + " failed: No such file or directory");
  EXPECT_FALSE(fm.createDirectoryAtURL(at("file/below"), true, 0755, &error));
  EXPECT_EQ(error.message(), "mkpath_np of " + at("file/below") + " failed: Not a directory");
  lockState->state = 1;
  EXPECT_FALSE(fm.createDirectoryAtURL(at("locked"), false, 0755, 0, 1, &error));
  EXPECT_EQ(error.code(), static_cast<uint64_t>(EPERM));
  EXPECT_EQ(error.message(), "Failed to setclass(1) on directory " + at("locked") + ": Operation not permitted");
}

TEST_F(FileManagerTest, TemporaryDirectoriesAreUniqueAndPrivate) {
  QRVError error;
  auto a = fm.createTemporaryDirectoryInDirectoryURL(root.path(), &error);
  auto b = fm.createTemporaryDirectoryInDirectoryURL(root.path() + "/", "com.kelva.UserManagedAssets.", &error);
  ASSERT_TRUE(a && b);
  EXPECT_EQ(a->substr(0, at("temp.").size()), at("temp."));
  EXPECT_EQ(a->size(), at("temp.").size() + 6);
  EXPECT_EQ(b->substr(0, at("com.kelva.UserManagedAssets.").size()), at("com.kelva.UserManagedAssets."));
  EXPECT_EQ(lstatOf(*a).st_mode & 07777, 0700u);
  EXPECT_FALSE(fm.createTemporaryDirectoryInDirectoryURL(at("missing"), &error));
  EXPECT_EQ(error.code(), static_cast<uint64_t>(ENOENT));
  EXPECT_EQ(error.message().find("Failed to create temp dir at path " + at("missing/temp.")), 0u);
  EXPECT_NE(error.message().find(" : No such file or directory"), std::string::npos);
}

// ---- Move and copy ----

TEST_F(FileManagerTest, MoveRenamesAndTreatsAMissingSourceByForm) {
  makeDirectories("src/inner");
  write("src/inner/f", "data");
  QRVError error;
  ASSERT_TRUE(fm.moveItemAtURL(at("src"), at("dst"), &error));
  EXPECT_FALSE(fs::exists(at("src")));
  EXPECT_TRUE(fs::exists(at("dst/inner/f")));

  EXPECT_TRUE(fm.moveItemIfExistsAtURL(at("src"), at("elsewhere"), &error));
  EXPECT_FALSE(fs::exists(at("elsewhere")));
  EXPECT_FALSE(fm.moveItemAtURL(at("src"), at("elsewhere"), &error));
  EXPECT_EQ(error.code(), static_cast<uint64_t>(ENOENT));
  EXPECT_EQ(error.message(),
            "rename of " + at("src") + " to " + at("elsewhere") + " failed: No such file or directory");

  EXPECT_TRUE(fm.copyItemIfExistsAtURL(at("src"), at("elsewhere"), &error));
  EXPECT_FALSE(fm.copyItemAtURL(at("src"), at("elsewhere"), &error));
  EXPECT_EQ(error.code(), static_cast<uint64_t>(ENOENT));
  ASSERT_TRUE(fm.copyItemAtURL(at("dst"), at("copy"), &error));
  EXPECT_TRUE(fs::exists(at("copy/inner/f")));
  EXPECT_FALSE(fm.copyItemAtURL(at("dst"), at("copy"), &error));
  EXPECT_EQ(error.message(), "copyfile of " + at("dst") + " to " + at("copy") + " failed: File exists");
}

// A directory on another file system than the temporary root, for moves
// that must copy.
class FileManagerCrossDeviceMoveTest : public FileManagerTest {
 protected:
  void SetUp() override {
    std::string pattern = "/dev/shm/quorvad-fm-test-XXXXXX";
    struct stat shm, tmp;
    if (stat("/dev/shm", &shm) != 0 || stat(root.path().c_str(), &tmp) != 0 || shm.st_dev == tmp.st_dev ||
        !mkdtemp(pattern.data()))
      GTEST_SKIP() << "no second file system to move to";
    other = pattern;
    makeDirectories("src/inner");
    write("src/inner/f", "cross-device");
    ASSERT_EQ(chmod(at("src/inner/f").c_str(), 0604), 0);
    link("f", "src/inner/l");
  }
  void TearDown() override {
    std::error_code ignored;
    if (!other.empty()) fs::remove_all(other, ignored);
  }
  std::string other;
};

TEST_F(FileManagerCrossDeviceMoveTest, CopiesThenRemovesTheSource) {
  QRVError error;
  ASSERT_TRUE(fm.moveItemAtURL(at("src"), other + "/moved", &error)) << error.description();
  EXPECT_FALSE(fs::exists(at("src")));
  std::ifstream in(other + "/moved/inner/f");
  std::string contents;
  in >> contents;
  EXPECT_EQ(contents, "cross-device");
  EXPECT_EQ(lstatOf(other + "/moved/inner/f").st_mode & 07777, 0604u);
  EXPECT_EQ(fs::read_symlink(other + "/moved/inner/l"), "f");
  EXPECT_EQ(fileSystem->calls(Op::kCopyItem), 1);
}

TEST_F(FileManagerCrossDeviceMoveTest, CopyFailureFailsTheMoveAndRemovalFailureDoesNot) {
  QRVError error;
  fileSystem->failNext(Op::kCopyItem, ENOSPC);
  EXPECT_FALSE(fm.moveItemAtURL(at("src"), other + "/moved", &error));
  EXPECT_EQ(error.code(), static_cast<uint64_t>(ENOSPC));
  EXPECT_TRUE(fs::exists(at("src/inner/f")));

  fileSystem->failNext(Op::kRemoveTree, EIO);
  EXPECT_TRUE(fm.moveItemAtURL(at("src"), other + "/moved", &error));
  EXPECT_TRUE(fs::exists(other + "/moved/inner/f"));
  EXPECT_TRUE(fs::exists(at("src/inner/f")));  // only logged
}

// ---- Removal ----

TEST_F(FileManagerTest, RemovalHandlesDeepReadOnlyTreesAndMissingPaths) {
  // Deeper than any path the system accepts, with read-only directories and
  // files along the way.
  ASSERT_EQ(mkdir(at("deep").c_str(), 0755), 0);
  int fd = open(at("deep").c_str(), O_RDONLY | O_DIRECTORY);
  const char* name = "a-directory-nested-deeply";
  for (int i = 0; i < 250; i++) {  // about 6500 bytes of path
    ASSERT_EQ(mkdirat(fd, name, 0755), 0);
    int next = openat(fd, name, O_RDONLY | O_DIRECTORY);
    if (i % 50 == 0) {
      close(openat(next, "read-only", O_CREAT | O_WRONLY, 0444));
      fchmod(next, geteuid() == 0 ? 0555 : 0755);
    }
    close(fd);
    fd = next;
  }
  close(fd);
  QRVError error;
  EXPECT_TRUE(fm.removeItemAtURL(at("deep"), &error)) << error.description();
  EXPECT_FALSE(fs::exists(at("deep")));

  EXPECT_TRUE(fm.removeItemAtURL(at("never-there"), &error));
  write("single");
  EXPECT_TRUE(fm.removeItemAtURL(at("single"), &error));
  EXPECT_FALSE(fm.removeItemAtURL("", &error));
  EXPECT_EQ(error.domain(), QRVError::kDomain);
  EXPECT_EQ(error.code(), 14u);
  EXPECT_EQ(error.message(), "nil url passed to -removeItemAtURL:error:");
}

TEST_F(FileManagerTest, RemovalClearsImmutableFilesAndDirectoriesButNotLinkTargets) {
  makeDirectories("tree/locked-dir/inner");
  makeDirectories("outside");
  write("tree/stuck");
  write("tree/locked-dir/inner/f");
  write("tree/locked-dir/g");
  write("outside/keep");
  link(at("outside"), "tree/out");
  if (!makeImmutable("tree/stuck")) GTEST_SKIP() << "this file system or user cannot set the immutable flag";
  ASSERT_TRUE(makeImmutable("tree/locked-dir"));
  QRVError error;
  EXPECT_TRUE(fm.removeItemAtURL(at("tree"), &error)) << error.description();
  EXPECT_FALSE(fs::exists(at("tree")));
  EXPECT_TRUE(fs::exists(at("outside/keep")));
}

TEST_F(FileManagerTest, RemovalReportsTheFirstErrorThatRemains) {
  makeDirectories("tree/sub");
  write("tree/sub/stuck");
  write("tree/other");
  if (!makeImmutable("tree/sub/stuck")) GTEST_SKIP() << "this file system or user cannot set the immutable flag";
  fileSystem->failNext(Op::kSetImmutableFlag, EPERM, 100);
  QRVError error;
  EXPECT_FALSE(fm.removeItemAtURL(at("tree"), &error));
  EXPECT_EQ(error.code(), static_cast<uint64_t>(EPERM));
  EXPECT_EQ(error.message(), "removefile of " + at("tree") + " failed: Operation not permitted");
  EXPECT_FALSE(fs::exists(at("tree/other")));
  makeImmutable("tree/sub/stuck", false);

  fileSystem->failNext(Op::kRemoveTree, EIO);
  EXPECT_FALSE(fm.removeItemAtURL(at("tree"), &error));
  EXPECT_EQ(error.message(), "removefile of " + at("tree") + " failed: Input/output error");
  EXPECT_TRUE(fm.removeItemAtURL(at("tree"), &error));
}

// ---- Data-protection classes ----

TEST_F(FileManagerTest, ClassGetSetWithPredicateAndLock) {
  write("file");
  QRVError error;
  uint32_t cls = 99;
  ASSERT_TRUE(fm.dataProtectionClassOfItemAtURL(at("file"), &cls, &error));
  EXPECT_EQ(cls, 0u);
  ASSERT_TRUE(fm.setDataProtectionClassOfItemAtURL(at("file"), 3, nullptr, &error));

  uint32_t seen = 0;
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

  lockState->state = 1;
  EXPECT_FALSE(fm.setDataProtectionClassOfItemAtURL(at("file"), 4, nullptr, &error));
  EXPECT_EQ(error.code(), static_cast<uint64_t>(EPERM));
  EXPECT_EQ(error.message(), "Failed to setclass(4) on file " + at("file") + ": Operation not permitted");
  lockState->state = 0;

  link("file", "link");
  EXPECT_FALSE(fm.setDataProtectionClassOfItemAtURL(at("link"), 4, nullptr, &error));
  EXPECT_EQ(error.code(), static_cast<uint64_t>(ELOOP));
  EXPECT_EQ(error.message(), "Failed to open " + at("link") + " : Too many levels of symbolic links");
  fileSystem->failNext(Op::kProtectionClass, EIO);
  EXPECT_FALSE(fm.dataProtectionClassOfItemAtURL(at("file"), &cls, &error));
  EXPECT_EQ(error.message(), "Failed to getclass of file " + at("file") + ": Input/output error");
}

// ---- Ownership and ACLs ----

TEST_F(FileManagerTest, OwnershipStandardisationSetsOwnerAndModesButSkipsMetadata) {
  if (geteuid() != 0) GTEST_SKIP() << "changing owners needs root";
  makeDirectories("c/dir");
  write("c/dir/tool");
  write("c/plain");
  write(std::string("c/") + QRVFileManager::kMetadataFileName);
  link("plain", "c/link");
  chmod(at("c/dir").c_str(), 0700);
  chmod(at("c/dir/tool").c_str(), 04710);
  chmod(at("c/plain").c_str(), 0600);
  chmod(at(std::string("c/") + QRVFileManager::kMetadataFileName).c_str(), 0600);
  QRVError error;
  ASSERT_TRUE(fm.standardizeOwnershipAtURL(at("c"), 501, 502, &error)) << error.description();
  for (const char* p : {"c", "c/dir", "c/dir/tool", "c/plain", "c/link"}) {
    EXPECT_EQ(lstatOf(at(p)).st_uid, 501u) << p;
    EXPECT_EQ(lstatOf(at(p)).st_gid, 502u) << p;
  }
  EXPECT_EQ(lstatOf(at("c/dir")).st_mode & 07777, 0755u);
  EXPECT_EQ(lstatOf(at("c/dir/tool")).st_mode & 07777, 0755u);  // set-id bits are gone
  EXPECT_EQ(lstatOf(at("c/plain")).st_mode & 07777, 0644u);
  struct stat metadata = lstatOf(at(std::string("c/") + QRVFileManager::kMetadataFileName));
  EXPECT_EQ(metadata.st_uid, 0u);
  EXPECT_EQ(metadata.st_mode & 07777, 0600u);

  EXPECT_FALSE(fm.standardizeOwnershipAtURL(at("missing"), 501, 501, &error));
  EXPECT_EQ(error.message(), "Could not stat " + at("missing") + ": No such file or directory");
}

class FileManagerSystemContainerACLTest : public FileManagerTest {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "changing owners needs root";
    makeDirectories("sys/c1/Library");
    makeDirectories("sys/c2");
    write("sys/c1/Library/file");
    write(std::string("sys/c1/") + QRVFileManager::kMetadataFileName);
    link("Library/file", "sys/c1/link");
    chmod(at("sys/c1").c_str(), 0755);
    if (real->setGroupACL(at("sys/c2"), {}) != 0) GTEST_SKIP() << "this file system has no POSIX ACLs";
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
  QRVError error;
  ASSERT_TRUE(fm.standardizeACLsForSystemContainerAtURL(at("sys/c1"), &error)) << error.description();
  // The container directory: top-level ACL only, owner and mode bits kept.
  EXPECT_EQ(lstatOf(at("sys/c1")).st_uid, 0u);
  EXPECT_EQ(lstatOf(at("sys/c1")).st_mode & 0707, 0705u);
  EXPECT_EQ(aclEntry(at("sys/c1"), ACL_TYPE_ACCESS, kSystemUsers), "-wx");
  EXPECT_EQ(aclEntry(at("sys/c1"), ACL_TYPE_DEFAULT, kSystemUsers), "rwx");
  // Inside: nobody's, mode 0 apart from the ACL mask in the group bits.
  for (const char* p : {"sys/c1/Library", "sys/c1/Library/file"}) {
    struct stat st = lstatOf(at(p));
    EXPECT_EQ(st.st_uid, QRVFileManager::kSystemContainerOwner) << p;
    EXPECT_EQ(st.st_gid, QRVFileManager::kSystemContainerOwner) << p;
    EXPECT_EQ(st.st_mode & 07777, 0070u) << p;
    EXPECT_EQ(aclEntry(at(p), ACL_TYPE_ACCESS, kSystemUsers), "rwx") << p;
  }
  EXPECT_EQ(aclEntry(at("sys/c1/Library"), ACL_TYPE_DEFAULT, kSystemUsers), "rwx");
  EXPECT_EQ(aclEntry(at("sys/c1/Library/file"), ACL_TYPE_DEFAULT, kSystemUsers), "none");
  EXPECT_EQ(lstatOf(at("sys/c1/link")).st_uid, QRVFileManager::kSystemContainerOwner);
  struct stat metadata = lstatOf(at(std::string("sys/c1/") + QRVFileManager::kMetadataFileName));
  EXPECT_EQ(metadata.st_uid, 0u);
  EXPECT_EQ(aclEntry(at(std::string("sys/c1/") + QRVFileManager::kMetadataFileName), ACL_TYPE_ACCESS, kSystemUsers),
            "none");

  // A member of the group can work inside; anyone else cannot.
  ASSERT_EQ(chmod(root.path().c_str(), 0755), 0);
  const std::string made = at("sys/c1/Library/made-by-member");
  const std::string existing = at("sys/c1/Library/file");
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
  QRVError error;
  // Not a system container: the starting directory is treated like the rest.
  ASSERT_TRUE(fm.standardizeACLsAtURL(at("sys/c2"), false, &error));
  EXPECT_EQ(lstatOf(at("sys/c2")).st_uid, QRVFileManager::kSystemContainerOwner);
  EXPECT_EQ(aclEntry(at("sys/c2"), ACL_TYPE_ACCESS, kSystemUsers), "rwx");

  ASSERT_TRUE(fm.standardizeAllSystemContainerACLsAtURL(at("sys"), &error));
  EXPECT_EQ(aclEntry(at("sys/c1"), ACL_TYPE_ACCESS, kSystemUsers), "-wx");
  EXPECT_EQ(aclEntry(at("sys/c2"), ACL_TYPE_ACCESS, kSystemUsers), "-wx");
  EXPECT_FALSE(fm.standardizeAllSystemContainerACLsAtURL(at("missing"), &error));
  EXPECT_EQ(error.code(), static_cast<uint64_t>(ENOENT));

  EXPECT_FALSE(fm.setTopLevelSystemContainerACLAtURL(at("sys/c1/link"), &error));
  EXPECT_EQ(error.message(), "Failed to set top level ACL on dir " + at("sys/c1/link") + ": Operation not supported");

  accounts->groups.clear();
  EXPECT_FALSE(fm.standardizeACLsForSystemContainerAtURL(at("sys/c1"), &error));
  EXPECT_EQ(error.message(), "Failed to find the group systemusers: No such file or directory");
}

// ---- Sizes, structure, homes ----

TEST_F(FileManagerTest, DiskUsageBothWaysAndTheFastPathFallbacks) {
  makeDirectories("c/sub");
  write("c/a", std::string(10000, 'a'));
  write("c/sub/b", std::string(50000, 'b'));
  int64_t expected = 0;
  for (const char* p : {"c", "c/sub", "c/a", "c/sub/b"}) expected += lstatOf(at(p)).st_blocks * 512;
  using Mode = QRVFileSystemExtras::StatisticsMode;

  EXPECT_EQ(fm.diskUsageForURL(at("c")), static_cast<uint64_t>(expected));
  EXPECT_EQ(fm.fastDiskUsageForURL(at("c")), static_cast<uint64_t>(expected));  // flag off
  EXPECT_EQ(fileSystem->statisticsModes(), (std::vector<Mode>{Mode::kComprehensive, Mode::kComprehensive}));

  flags->flags["quorvad/fast_container_sizing"] = true;
  fileSystem->failNext(Op::kDirectoryStatistics, ENOTSUP);
  EXPECT_EQ(fm.fastDiskUsageForURL(at("c")), static_cast<uint64_t>(expected));
  EXPECT_EQ(fileSystem->calls(Op::kEnableMaintainedDirectoryStatistics), 1);
  fileSystem->setStatisticsOverride(Mode::kFastOnly, {-5, 1});
  EXPECT_EQ(fm.fastDiskUsageForURL(at("c")), static_cast<uint64_t>(expected));
  EXPECT_EQ(fileSystem->statisticsModes().back(), Mode::kComprehensive);

  EXPECT_EQ(fm.diskUsageForURL(at("missing")), 0u);
  EXPECT_EQ(fm.diskUsageForURL(""), 0u);
}

TEST_F(FileManagerTest, DirectoryStructureGoesToTheLog) {
  makeDirectories("c/Library");
  write("c/Library/prefs", "12345");
  link("Library", "c/lib");
  std::string logPath = at("quorvad.log");
  ASSERT_TRUE(QRVLog::open("com.kelva.quorvad", logPath, 5, 1, 1 << 20));
  fm.printDirectoryStructureAtURL(at("c"));
  QRVLog::close();
  std::stringstream log;
  log << std::ifstream(logPath).rdbuf();
  EXPECT_NE(log.str().find(at("c") + "/ (mode 0"), std::string::npos) << log.str();
  EXPECT_NE(log.str().find("  Library/ (mode 0755"), std::string::npos) << log.str();
  EXPECT_NE(log.str().find("    prefs (mode 0644, owner "), std::string::npos) << log.str();
  EXPECT_NE(log.str().find("size 5)"), std::string::npos) << log.str();
  EXPECT_NE(log.str().find("  lib -> Library"), std::string::npos) << log.str();
}

TEST_F(FileManagerTest, HomeDirectoriesLieUnderTheRoot) {
  makeDirectories("private/var/mobile");
  accounts->accounts = {{"mobile", 501, 501, "/private/var/mobile"}, {"ghost", 502, 502, "/private/var/ghost"}};
  EXPECT_EQ(fm.homeDirectoryURLForPOSIXUID(501), realPath(at("private/var/mobile")));
  EXPECT_EQ(fm.homeDirectoryURLForPOSIXUID(502), at("private/var/mobile"));
  EXPECT_EQ(fm.homeDirectoryURLForPOSIXUID(999), at("private/var/mobile"));
}

}  // namespace

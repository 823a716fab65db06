// The Linux file-system extras on a real temporary directory, and the
// behaviour that the fake must share with them (protection classes).
#include "platform/linux/QRVLinuxFileSystemExtras.h"

#include <acl/libacl.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <iterator>

#include "platform/fake/QRVFakeFileSystemExtras.h"
#include "platform/fake/QRVFakePlatform.h"
#include "support/QRVTestServices.h"

namespace {

namespace fs = std::filesystem;

void writeFile(const std::string& path, const std::string& contents) { std::ofstream(path) << contents; }

std::string readFile(const std::string& path) {
  std::ifstream in(path);
  return std::string(std::istreambuf_iterator<char>(in), {});
}

bool canUseTrustedAttributes(const std::string& file) {
  if (geteuid() != 0 || setxattr(file.c_str(), "trusted.quorva.probe", "1", 1, 0) != 0) return false;
  removexattr(file.c_str(), "trusted.quorva.probe");
  return true;
}

bool canUseACLs(const std::string& file) {
  acl_t acl = acl_from_text("u::rwx,g::r--,g:12345:rwx,m::rwx,o::---");
  bool ok = acl && acl_set_file(file.c_str(), ACL_TYPE_ACCESS, acl) == 0;
  if (acl) acl_free(acl);
  return ok;
}

// One ACL as short text with numeric ids, e.g. "u::rw-,g::r--,g:42:rwx,m::rwx,o::---";
// empty when there is none.
std::string aclText(const std::string& path, acl_type_t type) {
  acl_t acl = acl_get_file(path.c_str(), type);
  char* text = acl ? acl_to_any_text(acl, nullptr, ',', TEXT_ABBREVIATE | TEXT_NUMERIC_IDS) : nullptr;
  std::string result = text ? text : "";
  acl_free(text);
  acl_free(acl);
  return result;
}

class LinuxFileSystemExtrasTest : public testing::Test {
 protected:
  void SetUp() override { ASSERT_FALSE(dir.path().empty()); }
  std::string at(const std::string& relative) const { return dir.path() + "/" + relative; }

  QRVTemporaryDirectory dir;
  std::shared_ptr<QRVFakeLockStateService> lockState = std::make_shared<QRVFakeLockStateService>();
  QRVLinuxFileSystemExtras extras{lockState};
};

// ---- Protection classes: the same behaviour from the real and the fake ----

class FileSystemProtectionClassConformanceTest : public LinuxFileSystemExtrasTest,
                                                 public testing::WithParamInterface<bool> {
 protected:
  void SetUp() override {
    writeFile(at("file"), "x");
    auto real = std::make_shared<QRVLinuxFileSystemExtras>(lockState);
    if (GetParam()) {
      auto fake = std::make_shared<QRVFakeFileSystemExtras>(real, lockState);
      fake->setInMemoryProtectionClasses(true);
      subject = fake;
    } else {
      if (!canUseTrustedAttributes(at("file"))) GTEST_SKIP() << "trusted extended attributes need root";
      subject = real;
    }
  }
  std::shared_ptr<QRVFileSystemExtras> subject;
};

TEST_P(FileSystemProtectionClassConformanceTest, UnsetReadsZeroSetReadsBackAndLockRefusesChange) {
  int fd = open(at("file").c_str(), O_RDONLY);
  ASSERT_GE(fd, 0);
  uint32_t cls = 99;
  EXPECT_EQ(subject->protectionClass(fd, &cls), 0);
  EXPECT_EQ(cls, 0u);
  EXPECT_EQ(subject->setProtectionClass(fd, 3), 0);
  lockState->state = 1;
  EXPECT_EQ(subject->setProtectionClass(fd, 1), EPERM);
  EXPECT_EQ(subject->protectionClass(fd, &cls), 0);  // reading still works while locked
  EXPECT_EQ(cls, 3u);
  lockState->state = 0;
  EXPECT_EQ(subject->setProtectionClass(fd, 1), 0);
  EXPECT_EQ(subject->protectionClass(fd, &cls), 0);
  EXPECT_EQ(cls, 1u);
  if (!GetParam()) {
    // On disk: four little-endian bytes, and anything else is reported, not
    // guessed at.
    ASSERT_EQ(subject->setProtectionClass(fd, 0x01020304), 0);
    unsigned char raw[8] = {};
    ASSERT_EQ(getxattr(at("file").c_str(), QRVLinuxFileSystemExtras::kProtectionClassAttribute, raw, sizeof raw), 4);
    EXPECT_EQ(std::vector<unsigned char>(raw, raw + 4), (std::vector<unsigned char>{4, 3, 2, 1}));
    ASSERT_EQ(setxattr(at("file").c_str(), QRVLinuxFileSystemExtras::kProtectionClassAttribute, "ab", 2, 0), 0);
    EXPECT_EQ(subject->protectionClass(fd, &cls), EINVAL);
  }
  close(fd);
}

INSTANTIATE_TEST_SUITE_P(RealAndFake, FileSystemProtectionClassConformanceTest, testing::Values(false, true),
                         [](const testing::TestParamInfo<bool>& p) { return p.param ? "Fake" : "Linux"; });

// ---- Immutable flag ----

TEST_F(LinuxFileSystemExtrasTest, ImmutableFlagOnFilesAndDirectoriesOnly) {
  writeFile(at("file"), "x");
  int fd = open(at("file").c_str(), O_RDONLY);
  int e = extras.setImmutableFlag(fd, true);
  if (e == ENOTSUP || e == EPERM) {
    close(fd);
    GTEST_SKIP() << "this file system or user cannot set the immutable flag";
  }
  ASSERT_EQ(e, 0);
  bool immutable = false;
  EXPECT_EQ(extras.immutableFlag(fd, &immutable), 0);
  EXPECT_TRUE(immutable);
  EXPECT_NE(unlink(at("file").c_str()), 0);
  EXPECT_EQ(errno, EPERM);
  EXPECT_EQ(extras.setImmutableFlag(fd, false), 0);
  EXPECT_EQ(extras.immutableFlag(fd, &immutable), 0);
  EXPECT_FALSE(immutable);
  close(fd);

  // A fifo's ioctls would reach no file system: never immutable, never set.
  ASSERT_EQ(mkfifo(at("fifo").c_str(), 0600), 0);
  fd = open(at("fifo").c_str(), O_RDONLY | O_NONBLOCK);
  EXPECT_EQ(extras.immutableFlag(fd, &immutable), 0);
  EXPECT_FALSE(immutable);
  EXPECT_EQ(extras.setImmutableFlag(fd, true), ENOTSUP);
  close(fd);
}

// ---- Group ACLs ----

TEST_F(LinuxFileSystemExtrasTest, GroupACLsKeepBaseRightsMapInheritanceAndRefuseLinks) {
  constexpr uint32_t kFull = 0x3FFE, kFileSet = 0x3FBE, kAddOnly = 0x624;
  writeFile(at("file"), "x");
  ASSERT_EQ(mkdir(at("dir").c_str(), 0750), 0);
  ASSERT_EQ(chmod(at("dir").c_str(), 0750), 0);
  if (!canUseACLs(at("file"))) GTEST_SKIP() << "this file system has no POSIX ACLs";
  acl_t clean = acl_from_mode(0640);
  ASSERT_EQ(acl_set_file(at("file").c_str(), ACL_TYPE_ACCESS, clean), 0);
  acl_free(clean);

  // A file: the named group with an rwx mask, the base rights as they were.
  ASSERT_EQ(extras.setGroupACL(at("file"), {{4242, kFileSet, QRVACLFlag::kInherited}}), 0);
  EXPECT_EQ(aclText(at("file"), ACL_TYPE_ACCESS), "u::rw-,g::r--,g:4242:rwx,m::rwx,o::---");
  // Inheritable entries become the default ACL, which new items take on.
  ASSERT_EQ(extras.setGroupACL(at("dir"), {{4242, kFull, QRVACLFlag::kFileInherit | QRVACLFlag::kDirectoryInherit}}),
            0);
  EXPECT_EQ(aclText(at("dir"), ACL_TYPE_ACCESS), "u::rwx,g::r-x,g:4242:rwx,m::rwx,o::---");
  EXPECT_EQ(aclText(at("dir"), ACL_TYPE_DEFAULT), "u::rwx,g::---,g:4242:rwx,m::rwx,o::---");
  writeFile(at("dir/new"), "y");
  EXPECT_NE(aclText(at("dir/new"), ACL_TYPE_ACCESS).find("g:4242:rwx"), std::string::npos);
  // The top-level pattern: adding without listing, full rights passed down.
  ASSERT_EQ(extras.setGroupACL(at("dir"), {{4242, kFull, 0x160}, {4242, kAddOnly, 0}}), 0);
  EXPECT_EQ(aclText(at("dir"), ACL_TYPE_ACCESS), "u::rwx,g::r-x,g:4242:-wx,m::rwx,o::---");
  EXPECT_EQ(aclText(at("dir"), ACL_TYPE_DEFAULT), "u::rwx,g::---,g:4242:rwx,m::rwx,o::---");
  // A new list replaces the old one, default ACL included.
  ASSERT_EQ(extras.setGroupACL(at("dir"), {{777, kFileSet, 0x10}}), 0);
  EXPECT_EQ(aclText(at("dir"), ACL_TYPE_ACCESS), "u::rwx,g::r-x,g:777:rwx,m::rwx,o::---");
  EXPECT_EQ(aclText(at("dir"), ACL_TYPE_DEFAULT), "");

  ASSERT_EQ(symlink("dir", at("link").c_str()), 0);
  EXPECT_EQ(extras.setGroupACL(at("link"), {{4242, kFull, 0}}), EOPNOTSUPP);
  EXPECT_EQ(aclText(at("dir"), ACL_TYPE_ACCESS), "u::rwx,g::r-x,g:777:rwx,m::rwx,o::---");  // the target is untouched
}

// ---- Copy ----

TEST_F(LinuxFileSystemExtrasTest, CopyKeepsDataMetadataAndLinksAsLinksAndNeverOverwrites) {
  ASSERT_EQ(mkdir(at("src").c_str(), 0755), 0);
  ASSERT_EQ(mkdir(at("src/sub").c_str(), 0700), 0);
  std::string big(300000, 'q');
  writeFile(at("src/sub/data"), big);
  ASSERT_EQ(chmod(at("src/sub/data").c_str(), 0751), 0);
  ASSERT_EQ(setxattr(at("src/sub/data").c_str(), "user.note", "hello", 5, 0), 0);
  ASSERT_TRUE(geteuid() != 0 || chown(at("src/sub/data").c_str(), 1234, 5678) == 0);
  struct timespec times[2] = {{1000000, 0}, {2000000, 500}};
  ASSERT_EQ(utimensat(AT_FDCWD, at("src/sub/data").c_str(), times, 0), 0);
  ASSERT_EQ(symlink("../../outside", at("src/sub/out").c_str()), 0);
  ASSERT_EQ(mkfifo(at("src/fifo").c_str(), 0640), 0);
  bool acls = canUseACLs(at("src/sub"));

  ASSERT_EQ(extras.copyItem(at("src"), at("dst")), 0);
  EXPECT_EQ(readFile(at("dst/sub/data")), big);
  struct stat a, b;
  ASSERT_EQ(lstat(at("src/sub/data").c_str(), &a), 0);
  ASSERT_EQ(lstat(at("dst/sub/data").c_str(), &b), 0);
  EXPECT_EQ(b.st_mode, a.st_mode);
  EXPECT_EQ(b.st_uid, a.st_uid);
  EXPECT_EQ(b.st_gid, a.st_gid);
  EXPECT_EQ(b.st_mtim.tv_sec, 2000000);
  EXPECT_EQ(b.st_mtim.tv_nsec, 500);
  char note[16] = {};
  EXPECT_EQ(getxattr(at("dst/sub/data").c_str(), "user.note", note, sizeof note), 5);
  EXPECT_STREQ(note, "hello");
  EXPECT_TRUE(!acls || aclText(at("dst/sub"), ACL_TYPE_ACCESS).find("g:12345:rwx") != std::string::npos);
  EXPECT_TRUE(fs::is_symlink(at("dst/sub/out")));
  EXPECT_EQ(fs::read_symlink(at("dst/sub/out")), "../../outside");
  ASSERT_EQ(lstat(at("dst/fifo").c_str(), &b), 0);
  EXPECT_TRUE(S_ISFIFO(b.st_mode));
  EXPECT_EQ(b.st_mode & 07777, 0640u);

  // A link given as the source is copied as a link.
  ASSERT_EQ(symlink("/etc/passwd", at("link").c_str()), 0);
  ASSERT_EQ(extras.copyItem(at("link"), at("linkcopy")), 0);
  EXPECT_EQ(fs::read_symlink(at("linkcopy")), "/etc/passwd");

  writeFile(at("old"), "old");
  EXPECT_EQ(extras.copyItem(at("src/sub/data"), at("old")), EEXIST);
  EXPECT_EQ(readFile(at("old")), "old");
  EXPECT_EQ(extras.copyItem(at("missing"), at("c")), ENOENT);
}

// ---- Removal ----

TEST_F(LinuxFileSystemExtrasTest, RemovalOfDeepTreesBoundsDescriptorsAndNeverFollowsLinks) {
  ASSERT_EQ(mkdir(at("outside").c_str(), 0755), 0);
  writeFile(at("outside/keep"), "k");
  // Deeper than the number of directories the walk keeps open and than any
  // path the system accepts, with a file and now and then a read-only
  // directory along the way, and a link out of the tree at the bottom.
  ASSERT_EQ(mkdir(at("tree").c_str(), 0755), 0);
  int fd = open(at("tree").c_str(), O_RDONLY | O_DIRECTORY);
  for (size_t i = 0; i < QRVLinuxFileSystemExtras::kMaxOpenDirectories * 3; i++) {
    close(openat(fd, "f", O_CREAT | O_WRONLY, 0444));
    ASSERT_EQ(mkdirat(fd, "a-directory-nested-deeply", 0755), 0);
    int next = openat(fd, "a-directory-nested-deeply", O_RDONLY | O_DIRECTORY);
    if (i % 50 == 0 && geteuid() == 0) fchmod(fd, 0555);  // root removes from it all the same
    close(fd);
    fd = next;
  }
  ASSERT_EQ(symlinkat(at("outside").c_str(), fd, "out"), 0);
  close(fd);
  auto openCount = [] { return std::distance(fs::directory_iterator("/proc/self/fd"), fs::directory_iterator()); };
  const auto before = openCount();
  int failures = 0;
  EXPECT_EQ(extras.removeTree(at("tree"),
                              [&](const QRVFileSystemExtras::RemovalFailure&) {
                                failures++;
                                return false;
                              }),
            0);
  EXPECT_EQ(failures, 0);
  EXPECT_FALSE(fs::exists(fs::symlink_status(at("tree"))));
  EXPECT_TRUE(fs::exists(at("outside/keep")));
  EXPECT_EQ(openCount(), before);
  EXPECT_EQ(extras.removeTree(at("tree"), nullptr), ENOENT);
  EXPECT_EQ(extras.removeTree("/", nullptr), EINVAL);
}

TEST_F(LinuxFileSystemExtrasTest, RemovalReportsWhatItCannotRemoveAndGoesOn) {
  ASSERT_EQ(mkdir(at("tree").c_str(), 0755), 0);
  ASSERT_EQ(mkdir(at("tree/sub").c_str(), 0755), 0);
  writeFile(at("tree/sub/stuck"), "x");
  writeFile(at("tree/sub/other"), "y");
  int fd = open(at("tree/sub/stuck").c_str(), O_RDONLY);
  if (extras.setImmutableFlag(fd, true) != 0) {
    close(fd);
    GTEST_SKIP() << "this file system or user cannot set the immutable flag";
  }
  std::vector<std::pair<std::string, int>> failures;
  bool inTree = false;
  EXPECT_EQ(extras.removeTree(at("tree"),
                              [&](const QRVFileSystemExtras::RemovalFailure& f) {
                                failures.emplace_back(f.path, f.errnum);
                                if (f.path == at("tree/sub/stuck")) inTree = f.directoryInTree;
                                return false;
                              }),
            0);
  extras.setImmutableFlag(fd, false);
  close(fd);
  // The file, then the directories that could not be emptied.
  EXPECT_EQ(failures, (std::vector<std::pair<std::string, int>>{
                          {at("tree/sub/stuck"), EPERM}, {at("tree/sub"), ENOTEMPTY}, {at("tree"), ENOTEMPTY}}));
  EXPECT_TRUE(inTree);
  EXPECT_FALSE(fs::exists(at("tree/sub/other")));
}

// ---- Statistics ----

TEST_F(LinuxFileSystemExtrasTest, StatisticsCountAllocatedBytesOnceAndFastEqualsComprehensive) {
  ASSERT_EQ(mkdir(at("tree").c_str(), 0755), 0);
  ASSERT_EQ(mkdir(at("tree/sub").c_str(), 0755), 0);
  writeFile(at("tree/a"), std::string(10000, 'a'));
  writeFile(at("tree/sub/b"), std::string(70000, 'b'));
  ASSERT_EQ(link(at("tree/a").c_str(), at("tree/sub/a-again").c_str()), 0);
  ASSERT_EQ(symlink("a", at("tree/l").c_str()), 0);
  int64_t expected = 0;
  for (const char* p : {"tree", "tree/sub", "tree/a", "tree/sub/b", "tree/l"}) {
    struct stat st;
    ASSERT_EQ(lstat(at(p).c_str(), &st), 0);
    expected += st.st_blocks * 512;
  }
  using Mode = QRVFileSystemExtras::StatisticsMode;
  QRVFileSystemExtras::DirectoryStatistics comprehensive, fast;
  ASSERT_EQ(extras.directoryStatistics(at("tree"), Mode::kComprehensive, &comprehensive), 0);
  ASSERT_EQ(extras.directoryStatistics(at("tree"), Mode::kFastOnly, &fast), 0);
  EXPECT_EQ(comprehensive.totalSize, expected);
  EXPECT_EQ(comprehensive.descendants, 5u);
  EXPECT_EQ(fast.totalSize, comprehensive.totalSize);
  EXPECT_EQ(extras.directoryStatistics(at("missing"), Mode::kComprehensive, &fast), ENOENT);
}

}  // namespace

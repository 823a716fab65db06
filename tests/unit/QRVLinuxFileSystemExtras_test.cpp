// The Linux file-system extras on a real temporary directory, and the
// behaviour that the fake must share with them (protection classes).
#include "linux/QRVLinuxFileSystemExtras.h"

#include <acl/libacl.h>
#include <dirent.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <map>

#include "fake/QRVFakeFileSystemExtras.h"
#include "fake/QRVFakePlatform.h"
#include "support/QRVTestServices.h"

namespace {

namespace fs = std::filesystem;

void writeFile(const std::string& path, const std::string& contents) { std::ofstream(path) << contents; }

bool canUseTrustedAttributes(const std::string& file) {
  if (geteuid() != 0) return false;
  if (setxattr(file.c_str(), "trusted.quorva.probe", "1", 1, 0) != 0) return false;
  removexattr(file.c_str(), "trusted.quorva.probe");
  return true;
}

bool canUseACLs(const std::string& file) {
  acl_t acl = acl_from_text("u::rwx,g::r--,g:12345:rwx,m::rwx,o::---");
  bool ok = acl && acl_set_file(file.c_str(), ACL_TYPE_ACCESS, acl) == 0;
  if (acl) acl_free(acl);
  return ok;
}

// The rights of every entry of one ACL: "u", "g", "o", "m" for the base
// entries and "g:<gid>" for named groups, each as "rwx"-style text.
std::map<std::string, std::string> readACL(const std::string& path, acl_type_t type) {
  std::map<std::string, std::string> entries;
  acl_t acl = acl_get_file(path.c_str(), type);
  if (!acl) return entries;
  acl_entry_t entry;
  for (int r = acl_get_entry(acl, ACL_FIRST_ENTRY, &entry); r == 1; r = acl_get_entry(acl, ACL_NEXT_ENTRY, &entry)) {
    acl_tag_t tag;
    acl_permset_t permset;
    acl_get_tag_type(entry, &tag);
    acl_get_permset(entry, &permset);
    std::string rights = std::string(acl_get_perm(permset, ACL_READ) ? "r" : "-") +
                         (acl_get_perm(permset, ACL_WRITE) ? "w" : "-") +
                         (acl_get_perm(permset, ACL_EXECUTE) ? "x" : "-");
    std::string key = tag == ACL_USER_OBJ    ? "u"
                      : tag == ACL_GROUP_OBJ ? "g"
                      : tag == ACL_OTHER     ? "o"
                      : tag == ACL_MASK      ? "m"
                                             : "?";
    if (tag == ACL_GROUP) {
      auto* gid = static_cast<gid_t*>(acl_get_qualifier(entry));
      key = "g:" + std::to_string(*gid);
      acl_free(gid);
    }
    entries[key] = rights;
  }
  acl_free(acl);
  return entries;
}

int openCount() {
  int n = 0;
  for (const auto& entry : fs::directory_iterator("/proc/self/fd")) {
    (void)entry;
    n++;
  }
  return n;
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
  EXPECT_EQ(subject->protectionClass(fd, &cls), 0);
  EXPECT_EQ(cls, 3u);

  lockState->state = 1;
  EXPECT_EQ(subject->setProtectionClass(fd, 1), EPERM);
  EXPECT_EQ(subject->protectionClass(fd, &cls), 0);  // reading still works while locked
  EXPECT_EQ(cls, 3u);
  lockState->state = 0;
  EXPECT_EQ(subject->setProtectionClass(fd, 1), 0);
  EXPECT_EQ(subject->protectionClass(fd, &cls), 0);
  EXPECT_EQ(cls, 1u);
  close(fd);
}

std::string implementationName(const testing::TestParamInfo<bool>& param) { return param.param ? "Fake" : "Linux"; }

INSTANTIATE_TEST_SUITE_P(RealAndFake, FileSystemProtectionClassConformanceTest, testing::Values(false, true),
                         implementationName);

TEST_F(LinuxFileSystemExtrasTest, ProtectionClassIsFourLittleEndianBytesInTrustedAttribute) {
  writeFile(at("file"), "x");
  if (!canUseTrustedAttributes(at("file"))) GTEST_SKIP() << "trusted extended attributes need root";
  int fd = open(at("file").c_str(), O_RDONLY);
  ASSERT_EQ(extras.setProtectionClass(fd, 0x01020304), 0);
  unsigned char raw[8] = {};
  ASSERT_EQ(getxattr(at("file").c_str(), "trusted.quorva.protection-class", raw, sizeof raw), 4);
  EXPECT_EQ(raw[0], 4);
  EXPECT_EQ(raw[3], 1);
  // An attribute that is not a class number is reported, not guessed at.
  ASSERT_EQ(setxattr(at("file").c_str(), "trusted.quorva.protection-class", "ab", 2, 0), 0);
  uint32_t cls = 0;
  EXPECT_EQ(extras.protectionClass(fd, &cls), EINVAL);
  close(fd);
}

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

class LinuxFileSystemGroupACLTest : public LinuxFileSystemExtrasTest {
 protected:
  void SetUp() override {
    writeFile(at("file"), "x");
    ASSERT_EQ(mkdir(at("dir").c_str(), 0750), 0);
    ASSERT_EQ(chmod(at("dir").c_str(), 0750), 0);
    if (!canUseACLs(at("file"))) GTEST_SKIP() << "this file system has no POSIX ACLs";
    ASSERT_EQ(chmod(at("file").c_str(), 0640), 0);  // also drops the probe's ACL entries from view
  }
  static constexpr gid_t kGroup = 4242;
  static constexpr uint32_t kFull = 0x3FFE, kFileSet = 0x3FBE, kAddOnly = 0x624;
};

TEST_F(LinuxFileSystemGroupACLTest, FileGetsNamedGroupWithRwxMaskAndKeepsBaseRights) {
  ASSERT_EQ(acl_delete_def_file(at("dir").c_str()), 0);
  acl_t clean = acl_from_mode(0640);
  ASSERT_EQ(acl_set_file(at("file").c_str(), ACL_TYPE_ACCESS, clean), 0);
  acl_free(clean);
  ASSERT_EQ(extras.setGroupACL(at("file"), {{kGroup, kFileSet, QRVACLFlag::kInherited}}), 0);
  std::map<std::string, std::string> expected = {
      {"u", "rw-"}, {"g", "r--"}, {"o", "---"}, {"m", "rwx"}, {"g:4242", "rwx"}};
  EXPECT_EQ(readACL(at("file"), ACL_TYPE_ACCESS), expected);
}

TEST_F(LinuxFileSystemGroupACLTest, InheritableEntriesBecomeTheDefaultACL) {
  ASSERT_EQ(extras.setGroupACL(at("dir"), {{kGroup, kFull, QRVACLFlag::kFileInherit | QRVACLFlag::kDirectoryInherit}}),
            0);
  EXPECT_EQ(readACL(at("dir"), ACL_TYPE_ACCESS)["g:4242"], "rwx");
  std::map<std::string, std::string> expectedDefault = {
      {"u", "rwx"}, {"g", "---"}, {"o", "---"}, {"m", "rwx"}, {"g:4242", "rwx"}};
  EXPECT_EQ(readACL(at("dir"), ACL_TYPE_DEFAULT), expectedDefault);

  // New items inherit it.
  writeFile(at("dir/new"), "y");
  EXPECT_EQ(readACL(at("dir/new"), ACL_TYPE_ACCESS)["g:4242"], "rwx");
}

TEST_F(LinuxFileSystemGroupACLTest, TopLevelPatternAddsWithoutListingAndPassesFullRightsDown) {
  ASSERT_EQ(extras.setGroupACL(at("dir"), {{kGroup, kFull, 0x160}, {kGroup, kAddOnly, 0}}), 0);
  EXPECT_EQ(readACL(at("dir"), ACL_TYPE_ACCESS)["g:4242"], "-wx");
  EXPECT_EQ(readACL(at("dir"), ACL_TYPE_DEFAULT)["g:4242"], "rwx");
}

TEST_F(LinuxFileSystemGroupACLTest, ReplacesEarlierEntriesAndRefusesLinks) {
  ASSERT_EQ(extras.setGroupACL(at("dir"), {{777, kFull, 0x60}}), 0);
  ASSERT_EQ(extras.setGroupACL(at("dir"), {{kGroup, kFileSet, 0x10}}), 0);
  auto access = readACL(at("dir"), ACL_TYPE_ACCESS);
  EXPECT_EQ(access.count("g:777"), 0u);
  EXPECT_EQ(access["g:4242"], "rwx");
  EXPECT_TRUE(readACL(at("dir"), ACL_TYPE_DEFAULT).empty());

  ASSERT_EQ(symlink("file", at("link").c_str()), 0);
  EXPECT_EQ(extras.setGroupACL(at("link"), {{kGroup, kFull, 0}}), EOPNOTSUPP);
  EXPECT_EQ(readACL(at("file"), ACL_TYPE_ACCESS).count("g:4242"), 0u);  // the target is untouched
}

// ---- Copy ----

TEST_F(LinuxFileSystemExtrasTest, CopyKeepsDataMetadataAndLinksAsLinks) {
  ASSERT_EQ(mkdir(at("src").c_str(), 0755), 0);
  ASSERT_EQ(mkdir(at("src/sub").c_str(), 0700), 0);
  ASSERT_EQ(mkdir(at("outside").c_str(), 0755), 0);
  writeFile(at("outside/secret"), "do not copy");
  std::string big(300000, 'q');
  writeFile(at("src/sub/data"), big);
  ASSERT_EQ(chmod(at("src/sub/data").c_str(), 0751), 0);
  ASSERT_EQ(setxattr(at("src/sub/data").c_str(), "user.note", "hello", 5, 0), 0);
  if (geteuid() == 0) {
    ASSERT_EQ(chown(at("src/sub/data").c_str(), 1234, 5678), 0);
  }
  struct timespec times[2] = {{1000000, 0}, {2000000, 500}};
  ASSERT_EQ(utimensat(AT_FDCWD, at("src/sub/data").c_str(), times, 0), 0);
  ASSERT_EQ(symlink("../../outside", at("src/sub/out").c_str()), 0);
  ASSERT_EQ(mkfifo(at("src/fifo").c_str(), 0640), 0);
  bool acls = canUseACLs(at("src/sub"));

  ASSERT_EQ(extras.copyItem(at("src"), at("dst")), 0);

  std::ifstream in(at("dst/sub/data"));
  std::string copied((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  EXPECT_EQ(copied, big);
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
  if (acls) {
    EXPECT_EQ(readACL(at("dst/sub"), ACL_TYPE_ACCESS)["g:12345"], "rwx");
  }

  char target[64] = {};
  ASSERT_GT(readlink(at("dst/sub/out").c_str(), target, sizeof target - 1), 0);
  EXPECT_STREQ(target, "../../outside");
  EXPECT_TRUE(fs::is_symlink(at("dst/sub/out")));
  ASSERT_EQ(lstat(at("dst/fifo").c_str(), &b), 0);
  EXPECT_TRUE(S_ISFIFO(b.st_mode));
  EXPECT_EQ(b.st_mode & 07777, 0640u);
}

TEST_F(LinuxFileSystemExtrasTest, CopyNeverOverwritesAndCopiesALinkItself) {
  writeFile(at("a"), "new");
  writeFile(at("b"), "old");
  EXPECT_EQ(extras.copyItem(at("a"), at("b")), EEXIST);
  std::ifstream in(at("b"));
  std::string contents;
  in >> contents;
  EXPECT_EQ(contents, "old");
  EXPECT_EQ(extras.copyItem(at("missing"), at("c")), ENOENT);

  ASSERT_EQ(symlink("/etc/passwd", at("link").c_str()), 0);
  ASSERT_EQ(extras.copyItem(at("link"), at("linkcopy")), 0);
  EXPECT_TRUE(fs::is_symlink(at("linkcopy")));
  EXPECT_EQ(fs::read_symlink(at("linkcopy")), "/etc/passwd");
}

// ---- Removal ----

TEST_F(LinuxFileSystemExtrasTest, RemovalBoundsDescriptorsAndNeverFollowsLinks) {
  ASSERT_EQ(mkdir(at("outside").c_str(), 0755), 0);
  writeFile(at("outside/keep"), "k");
  // Deeper than the number of directories the walk keeps open, with a link
  // out of the tree at the bottom.
  std::string path = at("tree");
  for (size_t i = 0; i < QRVLinuxFileSystemExtras::kMaxOpenDirectories * 3; i++) {
    ASSERT_EQ(mkdir(path.c_str(), 0755), 0);
    writeFile(path + "/f", "x");
    path += "/d";
  }
  ASSERT_EQ(symlink(at("outside").c_str(), (path).c_str()), 0);
  int before = openCount();
  std::vector<std::string> failures;
  EXPECT_EQ(extras.removeTree(at("tree"),
                              [&](const QRVFileSystemExtras::RemovalFailure& f) {
                                failures.push_back(f.path);
                                return false;
                              }),
            0);
  EXPECT_TRUE(failures.empty());
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
  ASSERT_GE(failures.size(), 3u);  // the file, then the directories that could not be emptied
  EXPECT_EQ(failures[0], std::make_pair(at("tree/sub/stuck"), EPERM));
  EXPECT_TRUE(inTree);
  EXPECT_EQ(failures[1], std::make_pair(at("tree/sub"), ENOTEMPTY));
  EXPECT_EQ(failures[2], std::make_pair(at("tree"), ENOTEMPTY));
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
  QRVFileSystemExtras::DirectoryStatistics comprehensive, fast;
  ASSERT_EQ(extras.directoryStatistics(at("tree"), QRVFileSystemExtras::StatisticsMode::kComprehensive, &comprehensive),
            0);
  ASSERT_EQ(extras.directoryStatistics(at("tree"), QRVFileSystemExtras::StatisticsMode::kFastOnly, &fast), 0);
  EXPECT_EQ(comprehensive.totalSize, expected);
  EXPECT_EQ(comprehensive.descendants, 5u);
  EXPECT_EQ(fast.totalSize, comprehensive.totalSize);
  EXPECT_EQ(extras.directoryStatistics(at("missing"), QRVFileSystemExtras::StatisticsMode::kComprehensive, &fast),
            ENOENT);
}

}  // namespace

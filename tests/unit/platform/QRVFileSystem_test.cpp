// The same scenarios against the Linux file system and against the
// fault-injection wrapper around it (with nothing injected): a test that
// passes over the wrapper says something about the real thing. Then what
// only the wrapper does: faults chosen by kind, order and path, and recorded
// owners.
#include <dirent.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/openat2.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <memory>

#include "platform/fake/QRVFaultInjectionFileSystem.h"
#include "platform/linux/QRVLinuxFileSystem.h"
#include "support/QRVTestServices.h"

namespace {

using Op = QRVFaultInjectionFileSystem::Operation;

class FileSystemConformanceTest : public testing::TestWithParam<bool> {
 protected:
  FileSystemConformanceTest() {
    auto linux = std::make_shared<QRVLinuxFileSystem>();
    if (GetParam())
      fs_ = std::make_shared<QRVFaultInjectionFileSystem>(linux);
    else
      fs_ = linux;
  }
  std::string at(const std::string& relative) const { return dir_.path() + "/" + relative; }

  QRVTemporaryDirectory dir_;
  std::shared_ptr<QRVFileSystem> fs_;
};

TEST_P(FileSystemConformanceTest, CallsReturnTheErrnoAndNeverFollowALinkUnasked) {
  QRVFileSystem& f = *fs_;
  ASSERT_EQ(f.makeDirectory(AT_FDCWD, at("d"), 0700), 0);
  EXPECT_EQ(f.makeDirectory(AT_FDCWD, at("d"), 0700), EEXIST);
  EXPECT_EQ(f.makeDirectory(AT_FDCWD, at("missing/d"), 0700), ENOENT);

  // Data in and out, through descriptors relative to the directory.
  int dir = -1, fd = -1;
  ASSERT_EQ(f.open(AT_FDCWD, at("d"), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC, 0, &dir), 0);
  ASSERT_EQ(f.open(dir, "file", O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600, &fd), 0);
  size_t done = 0;
  ASSERT_EQ(f.write(fd, "hello", 5, &done), 0);
  EXPECT_EQ(done, 5u);
  EXPECT_EQ(f.synchronize(fd), 0);
  EXPECT_EQ(f.changeModeOfFD(fd, 0640), 0);
  EXPECT_EQ(f.close(fd), 0);
  ASSERT_EQ(f.open(dir, "file", O_RDONLY | O_CLOEXEC, 0, &fd), 0);
  char buffer[16] = {};
  ASSERT_EQ(f.read(fd, buffer, sizeof buffer, &done), 0);
  EXPECT_EQ(std::string(buffer, done), "hello");
  ASSERT_EQ(f.read(fd, buffer, sizeof buffer, &done), 0);
  EXPECT_EQ(done, 0u);  // the end
  struct stat st;
  ASSERT_EQ(f.statusOfFD(fd, &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0640u);
  EXPECT_EQ(st.st_size, 5);
  f.close(fd);

  // Links: reported as links, refused by O_NOFOLLOW, resolved by realPath.
  ASSERT_EQ(symlink("file", at("d/link").c_str()), 0);
  std::string target;
  ASSERT_EQ(f.readLink(dir, "link", &target), 0);
  EXPECT_EQ(target, "file");
  EXPECT_EQ(f.readLink(dir, "file", &target), EINVAL);
  EXPECT_EQ(f.open(dir, "link", O_RDONLY | O_NOFOLLOW, 0, &fd), ELOOP);
  ASSERT_EQ(f.status(dir, "link", &st, AT_SYMLINK_NOFOLLOW), 0);
  EXPECT_TRUE(S_ISLNK(st.st_mode));
  EXPECT_EQ(f.changeMode(dir, "link", 0600, AT_SYMLINK_NOFOLLOW), EOPNOTSUPP);
  std::string real;
  ASSERT_EQ(f.realPath(at("d/link"), &real), 0);
  std::string realDir;
  ASSERT_EQ(f.realPath(dir_.path(), &realDir), 0);
  EXPECT_EQ(real, realDir + "/d/file");
  EXPECT_EQ(f.realPath(at("d/none/x"), &real), ENOENT);

  // The whole directory from its start, whatever was read before.
  std::vector<QRVFileSystem::DirectoryEntry> entries;
  ASSERT_EQ(f.readDirectory(dir, &entries), 0);
  ASSERT_EQ(f.readDirectory(dir, &entries), 0);
  std::vector<std::string> names;
  for (const auto& e : entries) names.push_back(e.name + (e.type == DT_LNK ? "@" : e.type == DT_UNKNOWN ? "?" : ""));
  std::sort(names.begin(), names.end());
  EXPECT_TRUE(names == (std::vector<std::string>{"file", "link@"}) ||
              names == (std::vector<std::string>{"file", "link?"}));

  // Renames and removals.
  EXPECT_EQ(f.rename(dir, "file", dir, "moved", 0), 0);
  EXPECT_EQ(f.rename(dir, "file", dir, "moved", 0), ENOENT);
  EXPECT_EQ(f.unlink(dir, "moved", AT_REMOVEDIR), ENOTDIR);
  EXPECT_EQ(f.unlink(dir, "moved", 0), 0);
  EXPECT_EQ(f.unlink(AT_FDCWD, at("d"), AT_REMOVEDIR), ENOTEMPTY);

  // Several components below the directory in one call, refusing a link in
  // any of them and any way out of it.
  constexpr uint64_t kBelow = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS;
  ASSERT_EQ(f.makeDirectory(dir, "sub", 0700), 0);
  ASSERT_EQ(f.open(dir, "sub/inner", O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600, &fd), 0);
  f.close(fd);
  ASSERT_EQ(symlink("sub", at("d/sublink").c_str()), 0);
  ASSERT_EQ(symlink("inner", at("d/sub/innerlink").c_str()), 0);
  int e = f.openResolved(dir, "sub/inner", O_RDONLY | O_CLOEXEC, kBelow, &fd);
  if (e != ENOSYS) {
    ASSERT_EQ(e, 0);
    f.close(fd);
    EXPECT_EQ(f.openResolved(dir, "sublink/inner", O_RDONLY | O_CLOEXEC, kBelow, &fd), ELOOP);
    EXPECT_EQ(f.openResolved(dir, "sub/innerlink", O_RDONLY | O_CLOEXEC, kBelow, &fd), ELOOP);
    EXPECT_EQ(f.openResolved(dir, "../d/sub/inner", O_RDONLY | O_CLOEXEC, kBelow, &fd), EXDEV);
    EXPECT_EQ(f.openResolved(dir, "sub/none", O_RDONLY | O_CLOEXEC, kBelow, &fd), ENOENT);
  }
  f.close(dir);

  // Temporary names are unique and made private.
  std::string a = at("t.XXXXXX"), b = a;
  ASSERT_EQ(f.makeTemporaryDirectory(&a), 0);
  ASSERT_EQ(f.makeTemporaryDirectory(&b), 0);
  EXPECT_NE(a, b);
  ASSERT_EQ(f.status(AT_FDCWD, a, &st, 0), 0);
  EXPECT_EQ(st.st_mode & 07777, 0700u);
  std::string t = at("f.XXXXXX");
  ASSERT_EQ(f.makeTemporaryFile(&t, O_CLOEXEC, &fd), 0);
  EXPECT_EQ(f.synchronizeFileSystem(fd), 0);
  f.close(fd);
  EXPECT_EQ(f.status(AT_FDCWD, t, &st, AT_SYMLINK_NOFOLLOW), 0);
  std::string bad = at("missing/f.XXXXXX");
  EXPECT_EQ(f.makeTemporaryFile(&bad, 0, &fd), ENOENT);
}

INSTANTIATE_TEST_SUITE_P(RealAndWrapped, FileSystemConformanceTest, testing::Bool(),
                         [](const testing::TestParamInfo<bool>& p) { return p.param ? "Wrapped" : "Linux"; });

TEST(FaultInjectionFileSystemTest, FaultsHitTheChosenCallAndOwnersAreRecorded) {
  QRVTemporaryDirectory dir;
  QRVFaultInjectionFileSystem f(std::make_shared<QRVLinuxFileSystem>());
  const std::string a = dir.path() + "/a", b = dir.path() + "/b";

  // The second matching call fails, the others reach the file system.
  f.inject(Op::kMakeDirectory, {.errnum = ENOSPC, .nth = 2, .pathContains = "/b"});
  EXPECT_EQ(f.makeDirectory(AT_FDCWD, a, 0700), 0);              // does not match
  EXPECT_EQ(f.makeDirectory(AT_FDCWD, b, 0700), 0);              // first match
  EXPECT_EQ(f.makeDirectory(AT_FDCWD, b + "/x", 0700), ENOSPC);  // second: injected
  EXPECT_EQ(f.makeDirectory(AT_FDCWD, b + "/x", 0700), 0);       // used up
  EXPECT_EQ(f.calls(Op::kMakeDirectory), 4);

  // A call on a descriptor matches the path it was opened with.
  int fd = -1;
  ASSERT_EQ(f.open(AT_FDCWD, b, O_RDONLY | O_DIRECTORY, 0, &fd), 0);
  f.inject(Op::kSynchronize, {.errnum = EIO, .times = QRVFaultInjectionFileSystem::kForever, .pathContains = "/b"});
  EXPECT_EQ(f.synchronize(fd), EIO);
  EXPECT_EQ(f.synchronize(fd), EIO);
  f.close(fd);
  ASSERT_EQ(f.open(AT_FDCWD, a, O_RDONLY | O_DIRECTORY, 0, &fd), 0);
  EXPECT_EQ(f.synchronize(fd), 0);
  f.clearFaults();
  f.close(fd);

  // Either path of a rename matches.
  f.failNext(Op::kRename, EXDEV, "/moved");
  EXPECT_EQ(f.rename(AT_FDCWD, a, AT_FDCWD, dir.path() + "/moved", 0), EXDEV);
  struct stat st;
  EXPECT_EQ(f.status(AT_FDCWD, a, &st, 0), 0);  // nothing happened

  // Recorded owners: reported by both status calls, the link's own when the
  // call does not follow it, and only for the item given.
  f.setRecordOwnership(true);
  ASSERT_EQ(symlink("a", (dir.path() + "/l").c_str()), 0);
  EXPECT_EQ(f.changeOwner(AT_FDCWD, dir.path() + "/l", 501, 502, AT_SYMLINK_NOFOLLOW), 0);
  ASSERT_EQ(f.status(AT_FDCWD, dir.path() + "/l", &st, AT_SYMLINK_NOFOLLOW), 0);
  EXPECT_EQ(st.st_uid, 501u);
  EXPECT_EQ(st.st_gid, 502u);
  ASSERT_EQ(f.status(AT_FDCWD, a, &st, 0), 0);
  EXPECT_EQ(st.st_uid, geteuid());
  ASSERT_EQ(f.open(AT_FDCWD, a, O_RDONLY | O_DIRECTORY, 0, &fd), 0);
  EXPECT_EQ(f.changeOwnerOfFD(fd, 700, static_cast<gid_t>(-1)), 0);  // -1 keeps the group
  ASSERT_EQ(f.statusOfFD(fd, &st), 0);
  EXPECT_EQ(st.st_uid, 700u);
  EXPECT_EQ(st.st_gid, getegid());
  f.close(fd);
  ASSERT_EQ(f.status(AT_FDCWD, dir.path() + "/l", &st, 0), 0);  // followed: the directory's owner
  EXPECT_EQ(st.st_uid, 700u);
  EXPECT_EQ(f.changeOwner(AT_FDCWD, dir.path() + "/none", 1, 1, 0), ENOENT);
}

}  // namespace

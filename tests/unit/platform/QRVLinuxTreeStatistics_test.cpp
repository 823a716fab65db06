// Directory statistics against hostile trees: what `du` says a tree
// occupies is what the daemon must answer, however deep the tree and
// whatever links it holds, and a tree it cannot measure is a failure.
#include "platform/linux/QRVLinuxTreeStatistics.h"

#include <dirent.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>

#include "platform/linux/QRVLinuxFileSystemExtras.h"
#include "support/QRVTestServices.h"

namespace {

using Statistics = QRVFileSystemExtras::DirectoryStatistics;

// `du -sB1` of `path` (allocated bytes, hard links once, links not
// followed), or -1 when du cannot be run.
int64_t duBytes(const std::string& path, const char* extra = "") {
  std::string command = std::string("du -sB1 ") + extra + " '" + path + "' 2>/dev/null";
  FILE* pipe = popen(command.c_str(), "r");
  if (!pipe) return -1;
  long long bytes = -1;
  if (fscanf(pipe, "%lld", &bytes) != 1) bytes = -1;
  return pclose(pipe) == 0 ? bytes : -1;
}

size_t openDescriptors() {
  size_t n = 0;
  DIR* dir = opendir("/proc/self/fd");
  while (dir && readdir(dir)) n++;
  if (dir) closedir(dir);
  return n;
}

// Writes `size` bytes at `offset` of the new file `name` in `directoryFD`.
void writeAt(int directoryFD, const char* name, off_t offset, size_t size) {
  int fd = openat(directoryFD, name, O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
  ASSERT_GE(fd, 0) << name;
  std::string data(size, 'x');
  ASSERT_EQ(pwrite(fd, data.data(), data.size(), offset), static_cast<ssize_t>(size));
  close(fd);
}

// The entries below the open directory `fd` (which it closes), counted by
// plain recursion with readdir: every name once, links not followed.
uint64_t countEntries(int fd) {
  DIR* dir = fdopendir(fd);
  if (!dir) return 0;
  uint64_t n = 0;
  while (const dirent* entry = readdir(dir)) {
    if (!strcmp(entry->d_name, ".") || !strcmp(entry->d_name, "..")) continue;
    n++;
    int child = openat(dirfd(dir), entry->d_name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (child >= 0) n += countEntries(child);
  }
  closedir(dir);
  return n;
}

class LinuxTreeStatisticsTest : public testing::Test {
 protected:
  void TearDown() override {
    // The deep chains are beyond what std::filesystem can remove.
    QRVLinuxFileSystemExtras extras(nullptr);
    extras.removeTree(at("tree"), nullptr);
  }
  std::string at(const std::string& relative) const { return dir.path() + "/" + relative; }

  // A chain of `levels` directories of 20-character names below `tree/`,
  // each holding a 3000-byte file, deeper than any path the system accepts.
  void makeChain(int levels) {
    int fd = open(at("tree").c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    ASSERT_GE(fd, 0);
    for (int i = 0; i < levels; i++) {
      const char* name = "abcdefghijklmnopqrst";
      ASSERT_EQ(mkdirat(fd, name, 0755), 0) << i;
      int child = openat(fd, name, O_RDONLY | O_DIRECTORY | O_CLOEXEC);
      close(fd);
      ASSERT_GE(child, 0) << i;
      fd = child;
      writeAt(fd, "f", 0, 3000);
    }
    close(fd);
  }

  QRVTemporaryDirectory dir;
};

TEST_F(LinuxTreeStatisticsTest, VariedTreeMatchesDuAndAReferenceCount) {
  for (const char* d : {"tree", "tree/a", "tree/b", "tree/empty", "tree/a/deep", "tree/many"})
    ASSERT_EQ(mkdir(at(d).c_str(), 0755), 0) << d;
  int tree = open(at("tree").c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  ASSERT_GE(tree, 0);
  writeAt(tree, "a/big", 0, 200000);
  writeAt(tree, "a/deep/small", 0, 10);
  writeAt(tree, "empty-file", 0, 0);
  writeAt(tree, "sparse", 64 << 20, 4096);  // 64 MiB long, one block written
  // Odd bytes in a name, a newline among them, must not split or end it.
  writeAt(tree, "odd\nname\x01\xff", 0, 7000);
  // Thousands of long names: one directory read is not enough to list them.
  std::string longName(60, 'm');
  for (int i = 0; i < 3000; i++) writeAt(tree, ("many/" + longName + std::to_string(i)).c_str(), 0, i % 3 ? 100 : 0);
  close(tree);
  // Three names for one file, a deep one and a shallow one: counted once.
  ASSERT_EQ(link(at("tree/a/big").c_str(), at("tree/a/deep/big-again").c_str()), 0);
  ASSERT_EQ(link(at("tree/a/big").c_str(), at("tree/big-third").c_str()), 0);
  // A file whose other name lies outside counts here, once.
  std::ofstream(at("outside")) << std::string(500000, 'o');
  ASSERT_EQ(link(at("outside").c_str(), at("tree/b/from-outside").c_str()), 0);
  // Links to a file outside, to a directory inside and to the tree's parent
  // are not followed.
  ASSERT_EQ(symlink(at("outside").c_str(), at("tree/out").c_str()), 0);
  ASSERT_EQ(symlink("a", at("tree/to-a").c_str()), 0);
  ASSERT_EQ(symlink("..", at("tree/up").c_str()), 0);
  makeChain(300);  // 300 * 21 characters: past PATH_MAX

  int64_t du = duBytes(at("tree"));
  if (du < 0) GTEST_SKIP() << "du is not available";
  // Through the extras, as the file manager asks.
  Statistics statistics;
  QRVLinuxFileSystemExtras extras(nullptr);
  ASSERT_EQ(extras.directoryStatistics(at("tree"), QRVFileSystemExtras::StatisticsMode::kComprehensive, &statistics),
            0);
  EXPECT_EQ(statistics.totalSize, du);
  tree = open(at("tree").c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  ASSERT_GE(tree, 0);
  EXPECT_EQ(statistics.descendants, countEntries(tree));
  // The chain alone is more than its files' bytes: it was walked to the end.
  Statistics chain;
  QRVLinuxTreeStatistics chainWalk;
  ASSERT_EQ(chainWalk.run(at("tree/abcdefghijklmnopqrst"), &chain), 0);
  EXPECT_EQ(chain.totalSize, duBytes(at("tree/abcdefghijklmnopqrst")));
  EXPECT_EQ(chain.descendants, 2u * 300u - 1u);
}

TEST_F(LinuxTreeStatisticsTest, DeepWalkKeepsFewDescriptorsAndClosesThemAll) {
  ASSERT_EQ(mkdir(at("tree").c_str(), 0755), 0);
  makeChain(600);
  size_t before = openDescriptors();
  // Far fewer descriptors than levels are available: the walk must re-find
  // shallower directories instead of holding one per level.
  struct rlimit saved;
  ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &saved), 0);
  struct rlimit tight = saved;
  tight.rlim_cur = before + QRVLinuxFileSystemExtras::kMaxOpenDirectories + 8;
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &tight), 0);
  Statistics statistics;
  int e;
  {
    QRVLinuxTreeStatistics walk;
    e = walk.run(at("tree"), &statistics);
  }
  setrlimit(RLIMIT_NOFILE, &saved);
  ASSERT_EQ(e, 0);
  EXPECT_EQ(statistics.descendants, 1200u);
  int64_t du = duBytes(at("tree"));
  if (du >= 0) {
    EXPECT_EQ(statistics.totalSize, du);
  }
  EXPECT_EQ(openDescriptors(), before);
}

TEST_F(LinuxTreeStatisticsTest, FailureIsNoPartialAnswer) {
  ASSERT_EQ(mkdir(at("tree").c_str(), 0755), 0);
  makeChain(100);
  Statistics statistics{12345, 6};
  {
    // Too few descriptors for the walk to get far: it must fail, not
    // answer what it saw before it had to stop.
    size_t before = openDescriptors();
    struct rlimit saved;
    ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &saved), 0);
    struct rlimit tight = saved;
    tight.rlim_cur = before + 1;
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &tight), 0);
    QRVLinuxTreeStatistics walk;
    int e = walk.run(at("tree"), &statistics);
    setrlimit(RLIMIT_NOFILE, &saved);
    EXPECT_EQ(e, EMFILE);
  }
  EXPECT_EQ(statistics.totalSize, 12345);  // untouched
  QRVLinuxTreeStatistics missing;
  EXPECT_EQ(missing.run(at("missing"), &statistics), ENOENT);
  EXPECT_EQ(missing.run("", &statistics), ENOENT);
}

TEST_F(LinuxTreeStatisticsTest, LinkAsStartingPointIsNotFollowed) {
  ASSERT_EQ(mkdir(at("tree").c_str(), 0755), 0);
  makeChain(3);
  ASSERT_EQ(symlink(at("tree").c_str(), at("link").c_str()), 0);
  struct stat st;
  ASSERT_EQ(lstat(at("link").c_str(), &st), 0);
  Statistics statistics;
  QRVLinuxTreeStatistics walk;
  ASSERT_EQ(walk.run(at("link"), &statistics), 0);
  EXPECT_EQ(statistics.totalSize, st.st_blocks * 512);
  EXPECT_EQ(statistics.descendants, 0u);
}

TEST_F(LinuxTreeStatisticsTest, MountsBelowTheTreeAreNotEntered) {
  ASSERT_EQ(mkdir(at("tree").c_str(), 0755), 0);
  ASSERT_EQ(mkdir(at("tree/bind").c_str(), 0755), 0);
  ASSERT_EQ(mkdir(at("tree/tmpfs").c_str(), 0755), 0);
  ASSERT_EQ(mkdir(at("elsewhere").c_str(), 0755), 0);
  std::ofstream(at("elsewhere/big")) << std::string(300000, 'e');
  std::ofstream(at("tree/own")) << std::string(5000, 'o');
  Statistics unmounted;
  QRVLinuxTreeStatistics first;
  ASSERT_EQ(first.run(at("tree"), &unmounted), 0);

  // A bind mount of the same file system keeps the device number: only the
  // mount identity tells it apart. Without it the walk would count the
  // bound directory, and a bind mount of an ancestor would send it round.
  if (mount(at("elsewhere").c_str(), at("tree/bind").c_str(), nullptr, MS_BIND, nullptr) != 0)
    GTEST_SKIP() << "cannot bind-mount here: " << strerror(errno);
  bool tmpfs = mount("tmpfs", at("tree/tmpfs").c_str(), "tmpfs", 0, "size=1m") == 0;
  if (tmpfs) std::ofstream(at("tree/tmpfs/big")) << std::string(300000, 't');
  Statistics statistics;
  QRVLinuxTreeStatistics walk;
  int e = walk.run(at("tree"), &statistics);
  if (tmpfs) umount2(at("tree/tmpfs").c_str(), MNT_DETACH);
  umount2(at("tree/bind").c_str(), MNT_DETACH);
  ASSERT_EQ(e, 0);
  // The mount points themselves are left out with what they hold.
  struct stat st;
  ASSERT_EQ(lstat(at("tree/bind").c_str(), &st), 0);
  int64_t mountPoints = st.st_blocks * 512;
  ASSERT_EQ(lstat(at("tree/tmpfs").c_str(), &st), 0);
  mountPoints += st.st_blocks * 512;
  EXPECT_EQ(statistics.totalSize, unmounted.totalSize - mountPoints);
  EXPECT_EQ(statistics.descendants, 1u);
}

}  // namespace

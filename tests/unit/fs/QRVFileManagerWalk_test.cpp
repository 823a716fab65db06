// The walk that never follows links, on real directories: entries that an
// application removes or swaps for links while the walk runs, trees deeper
// than the descriptors it keeps open, and an ancestor moved away under it.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <iterator>
#include <set>

#include "fs/QRVFileManager.h"
#include "support/QRVFiles.h"
#include "support/QRVTestServices.h"

namespace {

namespace fs = std::filesystem;
using Kind = QRVDirectoryEntry::Kind;

class FileManagerWalkTest : public testing::Test {
 protected:
  std::string dir(const std::string& relative) {
    std::string p = env_.root.path() + "/tree/" + relative;
    fs::create_directories(p);
    return p;
  }
  QRVFileManager& fm() { return *env_.services->fileManager; }
  QRVTestServices env_;
};

TEST_F(FileManagerWalkTest, EntriesRemovedOrSwappedForLinksDuringTheWalkAreNeitherErrorsNorFollowed) {
  QRVTemporaryDirectory outside;
  QRVWriteText(outside.path() + "/secret", "s");
  const std::string a = dir("a");
  for (const char* name : {"f1", "f2", "f3", "f4"}) QRVWriteText(a + "/" + name, "x");
  dir("a/d1");
  dir("a/d2");
  QRVWriteText(a + "/d1/inner", "x");

  // At the first entry delivered from inside "a", everything else in it is
  // replaced: half removed, half turned into links to the outside.
  std::set<std::string> delivered;
  bool swapped = false;
  QRVError error;
  bool ok = fm().traverseItemAtURLWithoutFollowingLinks(
      env_.root.path() + "/tree", &error, [&](const QRVDirectoryEntry& e, QRVError*) {
        const std::string path(e.path);
        delivered.insert(path);
        EXPECT_EQ(path.find(outside.path()), std::string::npos) << path;
        if (e.kind == Kind::kRegularFile || e.kind == Kind::kDirectoryPostOrder || e.kind == Kind::kDirectory) {
          struct stat st;
          EXPECT_GE(e.fd, 0) << path;
          EXPECT_EQ(fstat(e.fd, &st), 0);
          EXPECT_EQ(st.st_ino, e.stat->st_ino) << path;
        }
        if (!swapped && e.level == 2) {
          swapped = true;
          int n = 0;
          for (const auto& entry : fs::directory_iterator(a)) {
            if (entry.path().string() == path) continue;
            fs::remove_all(entry.path());
            if (n++ % 2 == 0) fs::create_directory_symlink(outside.path(), entry.path());
          }
        }
        return true;
      });
  EXPECT_TRUE(ok) << error.description();
  EXPECT_TRUE(swapped);
  EXPECT_FALSE(delivered.count(outside.path() + "/secret"));
  EXPECT_FALSE(delivered.count(a + "/d1/inner"));
  // The walk still finished the directory it was in.
  EXPECT_TRUE(delivered.count(a));
}

TEST_F(FileManagerWalkTest, AnyDepthWithBoundedDescriptorsAndAnAncestorMovedAwayEndsTheWalk) {
  std::string deep = dir("x");
  for (int i = 0; i < 100; i++) deep += "/d";
  fs::create_directories(deep);
  QRVWriteText(deep + "/leaf", "x");
  auto openDescriptors = [] {
    return std::distance(fs::directory_iterator("/proc/self/fd"), fs::directory_iterator());
  };
  const auto before = openDescriptors();
  int files = 0, postOrder = 0;
  QRVError error;
  ASSERT_TRUE(fm().traverseItemAtURLWithoutFollowingLinks(env_.root.path() + "/tree", &error,
                                                          [&](const QRVDirectoryEntry& e, QRVError*) {
                                                            files += e.kind == Kind::kRegularFile;
                                                            postOrder += e.kind == Kind::kDirectoryPostOrder;
                                                            // A hundred levels down, far fewer descriptors than levels
                                                            // are open.
                                                            if (e.kind == Kind::kRegularFile) {
                                                              EXPECT_LT(openDescriptors() - before, 40);
                                                            }
                                                            return true;
                                                          }))
      << error.description();
  EXPECT_EQ(files, 1);
  EXPECT_EQ(postOrder, 102);  // tree, x and the hundred below

  // Moving a closed ancestor elsewhere while below it: the walk cannot come
  // back up the way it went down, and says so instead of wandering.
  const std::string moved = env_.root.path() + "/moved";
  bool moveDone = false;
  bool ok = fm().traverseItemAtURLWithoutFollowingLinks(env_.root.path() + "/tree", &error,
                                                        [&](const QRVDirectoryEntry& e, QRVError*) {
                                                          if (!moveDone && e.kind == Kind::kRegularFile) {
                                                            moveDone = true;
                                                            std::string third = env_.root.path() + "/tree/x/d/d";
                                                            fs::create_directories(moved);
                                                            fs::rename(third, moved + "/d");
                                                            fs::create_directories(third);
                                                          }
                                                          return true;
                                                        });
  EXPECT_TRUE(moveDone);
  EXPECT_FALSE(ok);
  EXPECT_TRUE(error.isPOSIX());
  EXPECT_EQ(error.code(), static_cast<uint64_t>(ESTALE));

  // A missing starting point is an empty walk.
  EXPECT_TRUE(fm().traverseItemAtURLWithoutFollowingLinks(env_.root.path() + "/nothing", &error,
                                                          [](const QRVDirectoryEntry&, QRVError*) {
                                                            ADD_FAILURE();
                                                            return true;
                                                          }));
}

}  // namespace

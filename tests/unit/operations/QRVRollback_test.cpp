// The ways back out of a replace, a creation and a move to death row when a
// file-system call fails halfway: each answers its code and leaves on disk
// what that code promises, and nothing of the container that existed before
// is lost. The failures are injected into single calls of the real file
// system (QRVFaultInjectionFileSystem), chosen by the path they name.
#include <gtest/gtest.h>

#include <cerrno>
#include <filesystem>

#include "model/QRVContainerCache.h"
#include "model/QRVMetadata.h"
#include "operations/QRVClientConnection.h"
#include "support/QRVContainerTest.h"

namespace fs = std::filesystem;

namespace {

using Op = QRVFaultInjectionFileSystem::Operation;

class RollbackTest : public QRVContainerTest {
 protected:
  void SetUp() override {
    QRVContainerTest::SetUp();
    app_ = identity("com.example.app");
    old_ = create(app_);
    ASSERT_NE(old_, nullptr);
    QRVWriteText(old_->url() + "/Documents/precious", "old");
    fresh_ = create(app_, /*transient=*/true);
    ASSERT_NE(fresh_, nullptr);
    QRVWriteText(fresh_->url() + "/Documents/new", "new");
  }

  QRVFaultInjectionFileSystem& files() { return *env_.posixFileSystem; }
  QRVGlobalConfiguration& config() { return *env_.services->globalConfiguration; }
  std::string stagingParent() { return config().stagingDirectoryURLForUserIdentity(mobile(), app_->containerClass()); }
  std::string replaceDir() { return config().replaceDirectory(); }

  uint64_t replace(bool preserve = false) {
    QRVError error;
    bool replaced = admin()->replaceContainerIdentity(old_->containerIdentity(), fresh_->containerIdentity(), preserve,
                                                      /*startDeletionThread=*/false, &error);
    return replaced ? 1 : error.code();
  }
  // The UUID the metadata on disk at `url` names; empty when unreadable.
  std::string uuidOnDisk(const std::string& url) {
    QRVError error;
    auto m = QRVMetadata::readAndValidateMetadataAtUrl(url, mobile(), true, *env_.services->fileManager,
                                                       *env_.services->userIdentityCache, &error);
    return m ? m->uuid().string() : std::string();
  }
  // The old container is at its place with its files and its metadata, and
  // a cache that reads only the disk finds it there.
  void expectOldWhole() {
    EXPECT_EQ(QRVReadText(old_->url() + "/Documents/precious"), "old");
    EXPECT_EQ(uuidOnDisk(old_->url()), old_->uuid().string());
    freshCache();
    QRVError error;
    auto found = lookup(app_, &error);
    ASSERT_NE(found, nullptr) << error.description();
    EXPECT_EQ(found->url(), old_->url());
  }
  // Directories left in staging.
  size_t parked() { return QRVEntriesIn(stagingParent()); }
  void recover() {
    QRVError error;
    ASSERT_TRUE(admin()->TEST_recoverFromReplaceOperationsWithError(&error)) << error.description();
    EXPECT_EQ(QRVEntriesIn(replaceDir()), 0u);
  }

  QRVContainerIdentityRef app_;
  QRVMetadataRef old_, fresh_;
};

// ---- Replace ----

TEST_F(RollbackTest, ReplaceThatCannotParkTheOldContainerLeavesEverythingInPlace) {
  files().failNext(Op::kRename, EIO, old_->url());
  EXPECT_EQ(replace(), 14u);
  EXPECT_EQ(parked(), 0u);
  EXPECT_EQ(QRVReadText(fresh_->url() + "/Documents/new"), "new");
  // Nothing moved, so the journal goes with the failure: left behind it
  // would name nothing to put back.
  EXPECT_EQ(QRVEntriesIn(replaceDir()), 0u);
  expectOldWhole();
  recover();
  expectOldWhole();
}

TEST_F(RollbackTest, ReplaceWhoseJournalCannotBeWrittenAnswers34AndLeavesNothing) {
  struct {
    const char* what;
    Op op;
    std::string pathContains;
  } cases[] = {
      {"the replace directory", Op::kMakeDirectory, replaceDir()},
      {"the staging directory", Op::kMakeDirectory, stagingParent()},
      {"the journal's temporary file", Op::kMakeTemporaryFile, replaceDir()},
      {"the journal's write", Op::kWrite, replaceDir()},
      {"the journal's move into place", Op::kRename, replaceDir()},
      // The journal is in place, but its directory cannot be flushed: a
      // power loss could still lose it, so the replace must not go on.
      {"the flush of the replace directory", Op::kSynchronize, replaceDir()},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    files().inject(
        c.op,
        {.errnum = ENOSPC, .nth = 1, .times = QRVFaultInjectionFileSystem::kForever, .pathContains = c.pathContains});
    EXPECT_EQ(replace(), 34u);
    files().clearFaults();
    EXPECT_EQ(QRVEntriesIn(replaceDir()), 0u);
    EXPECT_EQ(parked(), 0u);
    EXPECT_EQ(QRVReadText(fresh_->url() + "/Documents/new"), "new");
    expectOldWhole();
  }
  EXPECT_EQ(replace(), 1u);
}

TEST_F(RollbackTest, ReplaceThatCannotPlaceTheNewContainerMovesTheOldOneBack) {
  struct {
    const char* what;
    bool preserve;
    int nth;  // of the renames naming the new container's place
    uint64_t code;
  } cases[] = {
      {"taking the new UUID", false, 1, 15},
      // Preserving, the old UUID is first written into the new container's
      // metadata (a rename inside it), then the container moves.
      {"preserving the old UUID", true, 2, 15},
      {"preserving, the metadata cannot be written", true, 1, 45},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    const bool preserve = c.preserve;
    files().inject(Op::kRename, {.errnum = EIO, .nth = c.nth, .pathContains = fresh_->url()});
    EXPECT_EQ(replace(preserve), c.code);
    expectOldWhole();
    EXPECT_EQ(parked(), 0u);
    EXPECT_EQ(QRVEntriesIn(replaceDir()), 0u);  // the journal went to death row
    // The new container is where it was, under its own identity again (a
    // preserving replace had already given it the old UUID).
    EXPECT_EQ(QRVReadText(fresh_->url() + "/Documents/new"), "new");
    EXPECT_EQ(uuidOnDisk(fresh_->url()), fresh_->uuid().string());
  }
  // Nothing was poisoned: without the fault the same replace goes through.
  EXPECT_EQ(replace(), 1u);
  EXPECT_EQ(
      QRVReadText(fs::path(old_->url()).parent_path().string() + "/" + fresh_->uuid().string() + "/Documents/new"),
      "new");
}

TEST_F(RollbackTest, ReplaceThatCannotMoveTheOldContainerBackLeavesItToRecovery) {
  files().failNext(Op::kRename, EIO, fresh_->url());
  // The first rename naming the old place parks it, the second is the way back.
  files().inject(Op::kRename, {.errnum = EIO, .nth = 2, .pathContains = old_->url()});
  EXPECT_EQ(replace(), 35u);
  // Parked, not lost: staging holds it whole, and the journal says whence.
  EXPECT_FALSE(fs::exists(old_->url()));
  ASSERT_EQ(parked(), 1u);
  const std::string parkedAt = fs::directory_iterator(stagingParent())->path().string();
  EXPECT_EQ(QRVReadText(parkedAt + "/Documents/precious"), "old");
  EXPECT_EQ(QRVEntriesIn(replaceDir()), 1u);
  recover();
  EXPECT_EQ(parked(), 0u);
  expectOldWhole();
  EXPECT_EQ(QRVReadText(fresh_->url() + "/Documents/new"), "new");
}

TEST_F(RollbackTest, ReplaceThatCannotSendLeftoversToDeathRowKeepsTheNewContainer) {
  const std::string dest = fs::path(old_->url()).parent_path().string() + "/" + fresh_->uuid().string();
  const std::string deathRow = config().deathrowDirectory();
  auto expectNewInPlace = [&] {
    EXPECT_EQ(QRVReadText(dest + "/Documents/new"), "new");
    freshCache();
    QRVError error;
    auto found = lookup(app_, &error);
    ASSERT_NE(found, nullptr) << error.description();
    EXPECT_EQ(found->url(), dest);
  };

  // The parked old directory cannot go: it stays parked for the cleanup, with
  // its journal, which recovery then discards (the new one is in place).
  files().failNext(Op::kMakeTemporaryDirectory, ENOSPC, deathRow);
  EXPECT_EQ(replace(), 36u);
  expectNewInPlace();
  ASSERT_EQ(parked(), 1u);
  EXPECT_EQ(QRVReadText(fs::directory_iterator(stagingParent())->path().string() + "/Documents/precious"), "old");
  EXPECT_EQ(QRVEntriesIn(replaceDir()), 1u);
  recover();
  expectNewInPlace();

  // Once more, where only the journal cannot go.
  old_ = lookup(app_, nullptr);
  ASSERT_NE(old_, nullptr);
  fresh_ = create(app_, /*transient=*/true);
  ASSERT_NE(fresh_, nullptr);
  files().inject(Op::kMakeTemporaryDirectory, {.errnum = ENOSPC, .nth = 2, .pathContains = deathRow});
  EXPECT_EQ(replace(), 36u);
  EXPECT_EQ(parked(), 1u);  // the first run's parked directory, nothing more
  EXPECT_EQ(QRVEntriesIn(replaceDir()), 1u);
  recover();
}

// ---- Creation ----

TEST_F(RollbackTest, CreationThatFailsBetweenItsStagingStepsPublishesNothing) {
  const std::string live = fs::path(old_->url()).parent_path().string();
  const size_t liveBefore = QRVEntriesIn(live);
  auto other = identity("com.example.other");
  struct Step {
    const char* what;
    Op op;
    std::string pathContains;
    int nth;
    uint64_t code;
  } steps[] = {
      {"staging directory", Op::kMakeDirectory, stagingParent() + "/", 1, 7},
      {"default subdirectory", Op::kMakeDirectory, "Documents", 1, 6},
      // The metadata is written beside the staging directory, then moved in.
      {"metadata write", Op::kOpen, "temp_metadata-", 1, 34},
      {"metadata move", Op::kRename, "temp_metadata-", 1, 34},
      {"move live", Op::kRename, stagingParent() + "/", 2, 8},
  };
  for (const Step& step : steps) {
    SCOPED_TRACE(step.what);
    files().inject(step.op, {.errnum = EIO, .nth = step.nth, .pathContains = step.pathContains});
    QRVError error;
    EXPECT_EQ(admin()->createOrLookupContainerWithContainerIdentity(other, /*createIfNecessary=*/true,
                                                                    /*transient=*/false, /*useLocking=*/true, &error),
              nullptr);
    EXPECT_EQ(error.code(), step.code) << error.description();
    EXPECT_EQ(QRVEntriesIn(live), liveBefore);
    // The half-built directory does not wait for the next start: the space
    // it holds may be what just ran out.
    EXPECT_EQ(parked(), 0u);
    freshCache();
    EXPECT_EQ(lookup(other, &error), nullptr);
    EXPECT_EQ(error.code(), 21u);
  }
  files().clearFaults();
  auto made = create(other);
  ASSERT_NE(made, nullptr);
  EXPECT_TRUE(fs::is_directory(made->url() + "/Documents"));
  expectOldWhole();
}

// ---- Death row ----

TEST_F(RollbackTest, AMoveToDeathRowThatFailsLeavesTheItemWhole) {
  const std::string deathRow = config().deathrowDirectory();
  QRVError error;
  // No place on death row.
  files().failNext(Op::kMakeTemporaryDirectory, ENOSPC, deathRow);
  EXPECT_FALSE(admin()->TEST_moveItemAtURLToDeathRow(old_->url(), true, false, &error));
  EXPECT_EQ(error.code(), 41u);
  // A place, but the move itself fails.
  files().failNext(Op::kRename, EIO, old_->url());
  EXPECT_FALSE(admin()->TEST_moveItemAtURLToDeathRow(old_->url(), true, false, &error));
  EXPECT_EQ(error.code(), 41u);
  expectOldWhole();

  // A transient container that cannot make way for a fresh one stays as it
  // was, and known.
  files().failNext(Op::kRename, EIO, fresh_->url());
  EXPECT_EQ(admin()->createOrLookupContainerWithContainerIdentity(app_, /*createIfNecessary=*/true,
                                                                  /*transient=*/true, /*useLocking=*/true, &error),
            nullptr);
  EXPECT_EQ(error.code(), 5u);
  EXPECT_EQ(QRVReadText(fresh_->url() + "/Documents/new"), "new");
  EXPECT_TRUE(known(fresh_));
}

}  // namespace

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <future>

#include "core/QRVCommandStageForDelete.h"
#include "operations/QRVClientConnection.h"
#include "support/QRVContainerTest.h"
#include "support/QRVEventually.h"
#include "support/QRVTestServices.h"

namespace fs = std::filesystem;

namespace {

class DeathRowTest : public testing::Test {
 protected:
  DeathRowTest() : connection_(QRVClientConnection::makeSharedClientConnection(env_.services)) {}

  std::string deathRow() { return env_.services->globalConfiguration->deathrowDirectory(); }
  std::string make(const std::string& name, bool dir) {
    std::string path = env_.root.path() + "/" + name;
    if (dir) {
      fs::create_directories(path + "/inner");
      std::ofstream(path + "/inner/file") << "data";
    } else {
      std::ofstream(path) << "data";
    }
    return path;
  }
  // Empties death row and waits for it.
  void emptyDeathRow() {
    std::promise<void> done;
    connection_->deleteContainersOnDeathRowWithCompletion([&] { done.set_value(); });
    ASSERT_EQ(done.get_future().wait_for(std::chrono::seconds(10)), std::future_status::ready);
  }
  size_t itemsOnDeathRow() {
    size_t n = 0;
    std::error_code gone;  // the background deletion may remove a directory while it is counted
    for (auto& unique : fs::directory_iterator(deathRow(), gone))
      n += static_cast<size_t>(std::distance(fs::directory_iterator(unique.path(), gone), fs::directory_iterator()));
    return n;
  }

  QRVTestServices env_;
  std::shared_ptr<QRVClientConnection> connection_;
};

TEST_F(DeathRowTest, ItemsOfOneNameNeverCollideAndNoPlaceThereIs41) {
  QRVError error;
  std::string a = make("same", true);
  ASSERT_TRUE(connection_->TEST_moveItemAtURLToDeathRow(a, /*isDir=*/true, /*startDeletionThread=*/false, &error))
      << error.description();
  std::string b = make("same", false);
  ASSERT_TRUE(connection_->TEST_moveItemAtURLToDeathRow(b, /*isDir=*/false, /*startDeletionThread=*/false, &error))
      << error.description();
  EXPECT_FALSE(fs::exists(a));
  EXPECT_EQ(itemsOnDeathRow(), 2u);
  // An item that is already gone counts as moved.
  EXPECT_TRUE(connection_->TEST_moveItemAtURLToDeathRow(env_.root.path() + "/never-was", /*isDir=*/true,
                                                        /*startDeletionThread=*/false, &error));

  emptyDeathRow();
  EXPECT_EQ(itemsOnDeathRow(), 0u);

  // A file where death row should be: no place can be made in it, 41.
  std::string item = make("x", true), dead = deathRow();  // asking again would remake it
  fs::remove_all(dead);
  std::ofstream(dead) << "in the way";
  EXPECT_FALSE(connection_->TEST_moveItemAtURLToDeathRow(item, /*isDir=*/true, /*startDeletionThread=*/false, &error));
  EXPECT_EQ(error.code(), 41u);
  EXPECT_TRUE(fs::exists(item));
}

TEST_F(DeathRowTest, StartingTheDeletionEmptiesDeathRowInTheBackground) {
  QRVError error;
  ASSERT_TRUE(
      connection_->TEST_moveItemAtURLToDeathRow(make("c", true), /*isDir=*/true, /*startDeletionThread=*/true, &error));
  EXPECT_TRUE(QRVEventually([&] { return itemsOnDeathRow() == 0; }));
  // The work held the daemon awake until it finished.
  EXPECT_TRUE(QRVEventually([&] { return env_.messages->isIdle(); }));
}

TEST_F(DeathRowTest, WhatCannotBeRemovedIsParkedInTmp) {
  QRVError error;
  std::string item = make("stubborn", true);
  env_.fileSystem->failNext(QRVFakeFileSystemExtras::Operation::kRemoveTree, EBUSY);
  fs::create_directories(env_.root.path() + "/tmp");
  ASSERT_TRUE(connection_->TEST_removeItemOrMoveToTempAtURL(item, &error)) << error.description();
  EXPECT_FALSE(fs::exists(item));
  EXPECT_TRUE(fs::exists(env_.root.path() + "/tmp/stubborn/inner/file"));

  // Without a place in /tmp either, the failure is reported as 4.
  std::string other = make("stubborn2", true);
  fs::remove_all(env_.root.path() + "/tmp");
  env_.fileSystem->failNext(QRVFakeFileSystemExtras::Operation::kRemoveTree, EBUSY);
  EXPECT_FALSE(connection_->TEST_removeItemOrMoveToTempAtURL(other, &error));
  EXPECT_EQ(error.code(), 4u);
  EXPECT_TRUE(fs::exists(other));
  // A missing item counts as removed.
  EXPECT_TRUE(connection_->TEST_removeItemOrMoveToTempAtURL(env_.root.path() + "/gone", &error));
}

TEST_F(DeathRowTest, StartUpCleanupEmptiesEveryStagingDirectory) {
  QRVGlobalConfiguration& config = *env_.services->globalConfiguration;
  auto user = env_.services->userIdentityCache->defaultUserIdentity();
  std::string global = config.stagingDirectory(), perUser = config.stagingDirectoryURLForUserIdentity(user, 2);
  fs::create_directories(global + "/half-built/Library");
  fs::create_directories(perUser + "/another");
  std::ofstream(perUser + "/temp_metadata-x.plist") << "x";
  std::promise<void> done;
  connection_->quorvaCleanupWithCompletion([&] { done.set_value(); });
  ASSERT_EQ(done.get_future().wait_for(std::chrono::seconds(10)), std::future_status::ready);
  EXPECT_TRUE(fs::is_empty(global));
  EXPECT_TRUE(fs::is_empty(perUser));
  // And what went to death row is deleted in the background.
  EXPECT_TRUE(QRVEventually([&] { return itemsOnDeathRow() == 0; }));
}

// Deletion staged by a request: containers leave the cache and go to death
// row through a command queue, as the delete commands run it.
class StageForDeleteTest : public QRVContainerTest {
 protected:
  bool run(std::vector<QRVContainerIdentityRef> ids, uint64_t* result, uint64_t* reported = nullptr) {
    QRVCommandQueue queue;
    queue.insertCommand(QRVCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
        std::move(ids), /*useLocking=*/true, [reported](uint64_t code) { if (reported) *reported = code; },
        env_.services));
    return queue.executeAllUntilExhaustedOrError(result);
  }
};

TEST_F(StageForDeleteTest, ContainersGoToDeathRowAndLeaveTheCache) {
  auto a = create(identity("com.example.a")), b = create(identity("com.example.b"));
  auto t = create(identity("com.example.t"), /*transient=*/true);
  ASSERT_TRUE(a && b && t);
  QRVError error;
  auto unknown = QRVContainerIdentity::containerIdentityWithUserIdentity(
      env_.services->userIdentityCache->defaultUserIdentity(), "com.example.none", 2, &error);
  uint64_t result = 1;
  EXPECT_TRUE(run({a->containerIdentity(), unknown, b->containerIdentity(), t->containerIdentity()}, &result));
  EXPECT_EQ(result, 1u);
  std::string deathRow = env_.services->globalConfiguration->deathrowDirectory();
  for (const auto& m : {a, b, t}) {
    EXPECT_FALSE(fs::exists(m->url()));
    EXPECT_TRUE(fs::exists(deathRow + "/" + m->uuid().string() + "/Documents"));
    EXPECT_FALSE(known(m));
  }
  // The launcher's mapping of a removed container is withdrawn.
  bool withdrawn = false;
  for (const auto& item : env_.sandbox->userStateItems)
    if (item.identifier == "com.example.a" && !item.path) withdrawn = true;
  EXPECT_TRUE(withdrawn);
}

TEST_F(StageForDeleteTest, MoveFailureDeletesInPlaceAndDoubleFailureIs28) {
  auto a = create(identity("com.example.a")), b = create(identity("com.example.b"));
  ASSERT_TRUE(a && b);
  // Something already lies on death row under a's name: the rename fails,
  // and the container is deleted where it is.
  std::string deathRow = env_.services->globalConfiguration->deathrowDirectory();
  fs::create_directories(deathRow + "/" + a->uuid().string() + "/occupied");
  uint64_t result = 1;
  EXPECT_TRUE(run({a->containerIdentity()}, &result));
  EXPECT_FALSE(fs::exists(a->url()));
  EXPECT_FALSE(known(a));

  fs::create_directories(deathRow + "/" + b->uuid().string() + "/occupied");
  env_.fileSystem->failNext(QRVFakeFileSystemExtras::Operation::kRemoveTree, EBUSY);
  uint64_t reported = 0;
  EXPECT_FALSE(run({b->containerIdentity()}, &result, &reported));
  EXPECT_EQ(result, 28u);
  EXPECT_EQ(reported, 28u);
  EXPECT_TRUE(known(b));
}

}  // namespace

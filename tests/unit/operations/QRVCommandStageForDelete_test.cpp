#include "core/QRVCommandStageForDelete.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>

#include "operations/QRVClientConnection.h"
#include "support/QRVTestServices.h"

namespace fs = std::filesystem;

namespace {

class StageForDeleteTest : public testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root: containers are given to their owners";
    connection_ = QRVClientConnection::makeSharedClientConnection(env_.services);
  }

  QRVMetadataRef create(const std::string& id, bool transient = false) {
    QRVError error;
    auto identity = QRVContainerIdentity::containerIdentityWithUserIdentity(
        env_.services->userIdentityCache->defaultUserIdentity(), id, QRVContainerClassAppData, &error);
    return connection_->createOrLookupContainerWithContainerIdentity(identity, true, transient, true, &error);
  }

  // Runs one stage-for-delete through a command queue, as a request would.
  bool run(std::vector<QRVContainerIdentityRef> ids, uint64_t* result, uint64_t* reported = nullptr) {
    QRVCommandQueue queue;
    queue.insertCommand(QRVCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
        std::move(ids), true, [reported](uint64_t code) { if (reported) *reported = code; }, env_.services));
    return queue.executeAllUntilExhaustedOrError(result);
  }

  bool known(const QRVMetadataRef& m) {
    return env_.services->containerCache->containerForContainerIdentity(*m->containerIdentity(), m->transient(), false,
                                                                        nullptr) != nullptr;
  }

  QRVTestServices env_;
  std::shared_ptr<QRVClientConnection> connection_;
};

TEST_F(StageForDeleteTest, ContainersGoToDeathRowAndLeaveTheCache) {
  auto a = create("com.example.a"), b = create("com.example.b"), t = create("com.example.t", true);
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
  auto a = create("com.example.a"), b = create("com.example.b");
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

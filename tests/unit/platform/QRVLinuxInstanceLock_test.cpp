#include "platform/linux/QRVLinuxInstanceLock.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <string>

#include "support/QRVTestServices.h"

namespace {

// flock conflicts between open files, not only between processes, so two
// claims in one test process stand for two daemons.
TEST(QRVLinuxInstanceLockTest, OnlyOneClaimOnAFileUntilItsHolderIsGone) {
  QRVTemporaryDirectory root;
  const std::string path = root.path() + "/run/quorvad/quorvad.lock";
  auto first = std::make_unique<QRVLinuxInstanceLock>(path);
  QRVError error;
  ASSERT_TRUE(first->acquire(&error)) << error.description();
  EXPECT_TRUE(first->acquire(&error));  // claiming again is harmless
  std::string contents;
  std::getline(std::ifstream(path), contents);
  EXPECT_EQ(contents, std::to_string(getpid()));

  QRVLinuxInstanceLock second(path);
  EXPECT_FALSE(second.acquire(&error));
  EXPECT_EQ(error.code(), static_cast<uint64_t>(EWOULDBLOCK));
  EXPECT_NE(error.message().find("another quorvad already runs on this root"), std::string::npos);
  EXPECT_NE(error.message().find(path), std::string::npos);

  first.reset();
  EXPECT_TRUE(second.acquire(&error)) << error.description();
}

TEST(QRVLinuxInstanceLockTest, UnusableLockFileIsAnErrorNotAClaim) {
  QRVTemporaryDirectory root;
  // A directory where the file should be.
  const std::string path = root.path() + "/run/quorvad/quorvad.lock";
  std::filesystem::create_directories(path);
  QRVLinuxInstanceLock lock(path);
  QRVError error;
  EXPECT_FALSE(lock.acquire(&error));
  EXPECT_NE(error.message().find("cannot open the lock file"), std::string::npos);
}

}  // namespace

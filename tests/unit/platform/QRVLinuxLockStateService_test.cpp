// The lock-state file as the daemon reads it: unobserved, every question
// reads the file; observed, the state follows every way of writing the file
// (in place, replaced by a rename, removed) once the watch has seen it, and
// observers are told only after the new state is readable.
#include "platform/linux/QRVLinuxLockStateService.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cstdio>
#include <filesystem>
#include <fstream>

#include "support/QRVEventually.h"
#include "support/QRVTestServices.h"

TEST(LinuxLockStateServiceTest, TheStateFollowsTheFileHoweverItIsWritten) {
  QRVTemporaryDirectory dir;
  const std::string path = dir.path() + "/run/lockstate";
  QRVLinuxLockStateService service(path);
  EXPECT_EQ(service.currentLockState(), 0) << "a missing file is unlocked";
  std::filesystem::create_directories(dir.path() + "/run");
  std::ofstream(path) << "1\n";
  EXPECT_EQ(service.currentLockState(), 1) << "unobserved, the file is read each time";

  // What an observer reads when told: never the state before the change.
  std::atomic<int> told{0}, toldState{-1};
  ASSERT_EQ(service.observe([&] {
              toldState = service.currentLockState();
              told++;
            }),
            0);
  EXPECT_EQ(service.currentLockState(), 1) << "the state at the start of the watch";

  auto expectSeen = [&](int state, const char* how) {
    EXPECT_TRUE(QRVEventually([&] { return service.currentLockState() == state; })) << how;
    EXPECT_TRUE(QRVEventually([&] { return toldState.load() == state; })) << how;
  };
  std::ofstream(path) << "0\n";
  expectSeen(0, "written in place");
  std::ofstream(path + ".new") << "1\n";
  ASSERT_EQ(rename((path + ".new").c_str(), path.c_str()), 0);
  expectSeen(1, "replaced by a rename");
  std::filesystem::remove(path);
  expectSeen(0, "removed");
  std::ofstream(path) << "locked\n";
  EXPECT_TRUE(QRVEventually([&] { return told.load() >= 4; }));
  EXPECT_EQ(service.currentLockState(), 0) << "not a number";
}

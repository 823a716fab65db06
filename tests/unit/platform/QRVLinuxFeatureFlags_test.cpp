// Feature flags are read once and again whenever the file changes: edited in
// place, replaced by a rename, removed, or not a property list.
#include <gtest/gtest.h>

#include <filesystem>

#include "base/QRVPlist.h"
#include "platform/linux/QRVLinuxFeatureFlags.h"
#include "support/QRVFiles.h"
#include "support/QRVTestServices.h"

namespace fs = std::filesystem;

namespace {

std::string flagsWith(bool enabled) {
  return QRVPlist::dictionary()
      .set("quorvad", QRVPlist::dictionary().set("fast_container_sizing", QRVPlist::boolean(enabled)))
      .toXML();
}

}  // namespace

TEST(LinuxFeatureFlagsTest, EveryChangeOfTheFileIsSeenAtTheNextQuestion) {
  QRVTemporaryDirectory dir;
  const std::string path = dir.path() + "/features.plist";
  QRVLinuxFeatureFlags flags(path);
  EXPECT_FALSE(flags.isEnabled("quorvad", "fast_container_sizing")) << "no file: off";

  QRVWriteText(path, flagsWith(true));
  EXPECT_TRUE(flags.isEnabled("quorvad", "fast_container_sizing"));
  EXPECT_FALSE(flags.isEnabled("quorvad", "other"));
  EXPECT_FALSE(flags.isEnabled("elsewhere", "fast_container_sizing"));

  // Rewritten in place, same inode and same size: the times tell.
  std::string renamed = flagsWith(true);
  renamed.replace(renamed.find("quorvad"), 7, "quorvaX");
  QRVWriteText(path, renamed);
  EXPECT_FALSE(flags.isEnabled("quorvad", "fast_container_sizing"));
  EXPECT_TRUE(flags.isEnabled("quorvaX", "fast_container_sizing"));

  // Replaced by a rename, as editors and package managers do.
  QRVWriteText(path + ".new", flagsWith(true));
  fs::rename(path + ".new", path);
  EXPECT_TRUE(flags.isEnabled("quorvad", "fast_container_sizing"));

  QRVWriteText(path, "not a property list");
  EXPECT_FALSE(flags.isEnabled("quorvad", "fast_container_sizing"));
  fs::remove(path);
  EXPECT_FALSE(flags.isEnabled("quorvad", "fast_container_sizing"));
  QRVWriteText(path, flagsWith(true));
  EXPECT_TRUE(flags.isEnabled("quorvad", "fast_container_sizing")) << "back after removal";
}

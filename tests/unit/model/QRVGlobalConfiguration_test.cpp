#include "model/QRVGlobalConfiguration.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "support/QRVTestServices.h"

namespace {

class LayoutTest : public testing::Test {
 protected:
  // Owner uid of `path`, or -1 when it does not exist.
  long ownerOf(const std::string& path) {
    struct stat st;
    // Through the seam: without root the owners given are recorded there.
    return env_.posixFileSystem->status(AT_FDCWD, path, &st, AT_SYMLINK_NOFOLLOW) == 0 ? static_cast<long>(st.st_uid)
                                                                                       : -1;
  }

  QRVUserIdentityRef user(uid_t uid, const std::string& home) {
    return QRVUserIdentity::make(uid, uid, env_.root.path() + home, "", QRVPersonaTypePersonal, 1000);
  }

  QRVTestServices env_;
  QRVGlobalConfiguration& config() { return *env_.services->globalConfiguration; }
  std::string r(const std::string& p) { return env_.root.path() + p; }
};

TEST_F(LayoutTest, EveryClassHasItsDirectoryForTwoUsersWithAndWithoutTransient) {
  auto alice = user(501, "/private/var/mobile");
  auto bob = user(502, "/home/bob");
  const std::string shared = r("/private/var/containers/");
  const std::string caches = r("/private/var/root/Library/Caches/com.kelva.quorvad/");
  for (QRVContainerClass c = 1; c <= 13; c++) {
    for (bool transient : {false, true}) {
      for (const auto& u : {alice, bob}) {
        auto dir = config().containerDirectoryURLForUserIdentity(u, c, transient);
        ASSERT_TRUE(dir) << c;
        std::string rel = QRVContainerClassRelativeDirectory(c);
        std::string expected;
        long owner;
        if (QRVContainerClassIsBundle(c)) {
          expected = shared + (transient ? "Temp/" : "") + rel;
          owner = CONTAINER_INSTALLATION_UID;
        } else if (QRVContainerClassIsSystem(c)) {
          expected = (transient ? caches + "Temp/" : shared) + rel;
          owner = geteuid();  // left alone: whoever made it, root on a device
        } else {
          expected = u->homeDirectoryURL() + "/Containers/" + (transient ? "Temp/" : "") + rel;
          owner = u->posixUID();
        }
        EXPECT_EQ(*dir, expected) << "class " << c << " transient " << transient;
        EXPECT_EQ(ownerOf(*dir), owner) << *dir;
      }
    }
  }
  EXPECT_EQ(ownerOf(r("/private/var/containers/Temp")), static_cast<long>(CONTAINER_INSTALLATION_UID));
  EXPECT_EQ(ownerOf(r("/home/bob/Containers")), 502);

  // Invalid classes have no directory; only bundle and system classes a
  // global base, which is not created by asking.
  for (QRVContainerClass bad : {0ULL, 14ULL, 99ULL}) EXPECT_FALSE(config().containerDirectoryURLForUserIdentity(alice, bad, false));
  EXPECT_FALSE(config().globalContainerBaseURLWithContentClass(2, false));
  std::filesystem::remove_all(r("/private/var/containers/Bundle"));
  EXPECT_EQ(*config().globalContainerBaseURLWithContentClass(1, false), shared + "Bundle/Application");
  EXPECT_FALSE(std::filesystem::exists(shared + "Bundle/Application"));
}

TEST_F(LayoutTest, DaemonDirectoriesStagingAndRecreation) {
  auto alice = user(501, "/private/var/mobile");
  const std::string home = r("/private/var/root/");
  EXPECT_EQ(config().homeDirectory(), home);
  EXPECT_EQ(config().libraryDirectory(), home + "Library/Quorva");
  EXPECT_EQ(config().replaceDirectory(), home + "Library/Quorva/Replace");
  EXPECT_EQ(config().pendingUpdatesDirectory(), home + "Library/Quorva/PendingUpdates");
  EXPECT_EQ(config().deathrowDirectory(), home + "Library/Caches/com.kelva.quorvad/Dead");
  EXPECT_EQ(config().stagingDirectory(), home + "Library/Caches/com.kelva.quorvad/Staging");
  EXPECT_EQ(config().logDirectory(), home + "Library/Logs/Quorva");
  EXPECT_EQ(config().legacyTransientBundleDirectory(), r("/private/var/verdaned/Library/Caches/com.kelva.quorvad"));
  EXPECT_FALSE(std::filesystem::exists(config().legacyTransientBundleDirectory()));

  // Staging follows the class: per-user classes stage in the user's tree.
  EXPECT_EQ(config().stagingDirectoryURLForUserIdentity(alice, 7), alice->homeDirectoryURL() + "/Containers/Staging");
  EXPECT_EQ(config().stagingDirectoryURLForUserIdentity(alice, 13), config().stagingDirectory());
  EXPECT_EQ(config().stagingDirectoryURLForUserIdentity(alice, 1), config().stagingDirectory());

  // A directory removed behind the daemon's back comes back on next access.
  std::filesystem::remove_all(home + "Library/Caches");
  EXPECT_TRUE(std::filesystem::is_directory(config().deathrowDirectory()));

  auto perUser = config().getPerUserConfigurationForUserIdentity(alice);
  EXPECT_EQ(perUser, config().getPerUserConfigurationForUserIdentity(user(501, "/elsewhere")));  // same identity
  EXPECT_EQ(perUser->libraryDirectory(), alice->homeDirectoryURL() + "/Library/Quorva");
  EXPECT_EQ(ownerOf(perUser->libraryDirectory()), 501);
  EXPECT_EQ(perUser->systemContainerBackupDirectory(),
            alice->homeDirectoryURL() + "/Library/Backup/SystemContainers/Data");
  EXPECT_FALSE(std::filesystem::exists(perUser->systemContainerBackupBaseDirectory()));

  auto carol = user(503, "/home/carol");
  auto carolConfig = config().getPerUserConfigurationForUserIdentity(carol);
  EXPECT_FALSE(carolConfig->existsUserBaseDirectory());
  carolConfig->userBaseDirectory();
  EXPECT_TRUE(carolConfig->existsUserBaseDirectory());
}

TEST_F(LayoutTest, DirectoryThatCannotBeCreatedStillYieldsItsPath) {
  // A file where the caches tree should be.
  std::filesystem::create_directories(r("/private/var/root/Library"));
  { std::ofstream(r("/private/var/root/Library/Caches")) << "x"; }
  EXPECT_EQ(config().deathrowDirectory(), r("/private/var/root/Library/Caches/com.kelva.quorvad/Dead"));
  EXPECT_FALSE(std::filesystem::exists(config().deathrowDirectory()));
}

TEST_F(LayoutTest, MobileAccount) {
  EXPECT_EQ(config().currentMobileUserId(), 501u);
  EXPECT_EQ(config().currentMobileGroupId(), 501u);

  // Without a "mobile" account both ids stay 0.
  QRVGlobalConfiguration bare(env_.root.path(), env_.systemInfo, std::make_shared<QRVFakeAccounts>(),
                              env_.services->fileManager);
  EXPECT_EQ(bare.currentMobileUserId(), 0u);
}

}  // namespace

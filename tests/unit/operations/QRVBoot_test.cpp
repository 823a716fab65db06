// The work of the first start after a device boot. Set-up: system containers
// restored from a backup child by child, with what cannot be restored kept
// aside, and system container paths rolled after a build upgrade. Cleanup:
// transient containers of every kind go, a directory that looks like a
// container but lost its metadata goes, and whatever the daemon cannot
// recognise as its own stays.
#include <gtest/gtest.h>

#include <filesystem>
#include <future>

#include "base/QRVUUID.h"
#include "support/QRVContainerTest.h"
#include "support/QRVLogCapture.h"

namespace fs = std::filesystem;

namespace {

class BootTest : public QRVContainerTest {
 protected:
  // Runs the reboot cleanup and waits for its completion.
  void rebootCleanup() {
    std::promise<void> done;
    admin()->rebootQuorvaCleanupWithCompletion([&] { done.set_value(); });
    ASSERT_EQ(done.get_future().wait_for(std::chrono::seconds(10)), std::future_status::ready);
  }
  // Whether an item named `name` waits on death row.
  bool onDeathRow(const std::string& name) {
    const std::string deathRow = env_.services->globalConfiguration->deathrowDirectory();
    if (!fs::exists(deathRow)) return false;
    for (const auto& unique : fs::directory_iterator(deathRow))
      if (fs::exists(unique.path() / name)) return true;
    return false;
  }
};

}  // namespace

TEST_F(BootTest, TransientTreesAndOrphansGoWhatIsNotTheDaemonsStays) {
  QRVMetadataRef live = create(identity("com.example.live"));
  QRVMetadataRef transient = create(identity("com.example.scratch"), /*transient=*/true);
  QRVMetadataRef bundle = create(identity("com.example.live", QRVContainerClassAppBundle));
  ASSERT_TRUE(live && transient && bundle);
  ASSERT_TRUE(fs::exists(transient->url()));

  // A data container that lost its metadata (a crash of an older system),
  // one whose name is a UUID but that is a file, a bundle that lost its
  // metadata, and an administrator's notes beside them.
  const fs::path dataClass = fs::path(live->url()).parent_path();
  const fs::path orphan = dataClass / QRVUUID::random().string();
  fs::create_directories(orphan / "Documents");
  QRVWriteText((orphan / "Documents" / "left").string(), "x");
  const fs::path orphanFile = dataClass / QRVUUID::random().string();
  QRVWriteText(orphanFile.string(), "x");
  const fs::path bundleOrphan = fs::path(bundle->url()).parent_path() / QRVUUID::random().string();
  fs::create_directories(bundleOrphan);
  const fs::path notes = dataClass / "notes";
  fs::create_directories(notes);

  QRVLogCapture log(env_.root.path());
  rebootCleanup();

  EXPECT_FALSE(fs::exists(transient->url()));
  EXPECT_FALSE(fs::exists(orphan));
  EXPECT_FALSE(fs::exists(orphanFile));
  EXPECT_FALSE(fs::exists(bundleOrphan));
  EXPECT_TRUE(onDeathRow(orphan.filename().string())) << "orphans are sent to death row, not deleted in place";
  EXPECT_TRUE(fs::exists(live->url() + "/.com.kelva.quorva.metadata.plist"));
  EXPECT_TRUE(fs::exists(bundle->url()));
  EXPECT_TRUE(fs::exists(notes)) << "a name that is no container's is not the daemon's to delete";
  EXPECT_NE(log.text().find("Deleting orphaned data missing a metadata file at: " + orphan.string()),
            std::string::npos);

  // Nothing left to do: a second boot finds nothing more, logs no error and
  // gives death row nothing to empty.
  QRVError error;
  EXPECT_NE(lookup(live->containerIdentity(), &error), nullptr) << error.description();
  const std::string deathRow = env_.services->globalConfiguration->deathrowDirectory();
  fs::remove_all(deathRow);
  const size_t before = log.text().size();
  rebootCleanup();
  EXPECT_TRUE(!fs::exists(deathRow) || fs::is_empty(deathRow));
  EXPECT_EQ(log.text().substr(before).find("<Error>"), std::string::npos) << log.text().substr(before);
  EXPECT_TRUE(fs::exists(live->url()));
}

TEST_F(BootTest, ABackupIsRestoredChildByChildAndWhatFailsIsKeptAside) {
  QRVMetadataRef system = create(identity("com.example.sys", QRVContainerClassSystemData));
  ASSERT_NE(system, nullptr);
  file(system->url() + "/Library/old");
  file(system->url() + "/keep.txt");

  auto perUser = env_.services->globalConfiguration->getPerUserConfigurationForUserIdentity(
      env_.services->userIdentityCache->defaultUserIdentity());
  const std::string data = perUser->systemContainerBackupDirectory();
  const std::string shared = perUser->systemGroupContainerBackupDirectory();
  file(data + "/com.example.sys/Library/restored");
  file(data + "/com.example.sys/new.txt");
  file(data + "/com.example.newsys/a.txt");
  file(data + "/stray-file");
  file(shared + "/systemgroup.com.example.g/g.txt");
  // The one child that cannot be moved into place.
  env_.posixFileSystem->failNext(QRVFaultInjectionFileSystem::Operation::kRename, EIO, "new.txt");

  QRVLogCapture log(env_.root.path());
  admin()->rebootQuorvaSetup();

  auto live = [&](const std::string& id, QRVContainerClass c) {
    QRVError error;
    QRVMetadataRef m = lookup(identity(id, c), &error);
    EXPECT_NE(m, nullptr) << id << ": " << error.description();
    return m ? m->url() : std::string("/nonexistent");
  };
  const std::string sys = live("com.example.sys", QRVContainerClassSystemData);
  EXPECT_TRUE(fs::exists(sys + "/Library/restored"));
  EXPECT_FALSE(fs::exists(sys + "/Library/old")) << "a restored child replaces the live one whole";
  EXPECT_TRUE(fs::exists(sys + "/keep.txt")) << "what the backup does not hold stays";
  EXPECT_FALSE(fs::exists(sys + "/new.txt"));
  EXPECT_TRUE(fs::exists(live("com.example.newsys", QRVContainerClassSystemData) + "/a.txt"));
  EXPECT_TRUE(fs::exists(live("systemgroup.com.example.g", QRVContainerClassSystemGroup) + "/g.txt"));

  // Nothing that could not be restored is lost; the rest of the backup goes.
  EXPECT_TRUE(fs::exists(data + ".failed/com.example.sys/new.txt"));
  EXPECT_TRUE(fs::exists(data + ".failed/stray-file"));
  EXPECT_FALSE(fs::exists(data));
  EXPECT_FALSE(fs::exists(data + ".inprogress"));
  EXPECT_FALSE(fs::exists(shared + ".inprogress"));
  const std::string text = log.text();
  EXPECT_NE(text.find("Installing system containers"), std::string::npos);
  EXPECT_NE(text.find("Installing system group containers"), std::string::npos);
  EXPECT_NE(text.find("Restoring container for com.example.sys at " + data + ".inprogress/com.example.sys to " + sys),
            std::string::npos);
  EXPECT_NE(text.find("Failed to move file in restored system container com.example.sys:"), std::string::npos);
}

// A new build rolls every system container's directory to a new UUID, keeping
// its contents, except the shared system group; the same build again does
// nothing.
TEST_F(BootTest, ANewBuildRollsSystemContainerPathsOnce) {
  QRVMetadataRef system = create(identity("com.example.sys", QRVContainerClassSystemData));
  QRVMetadataRef group = create(identity("systemgroup.com.example.g", QRVContainerClassSystemGroup));
  QRVMetadataRef sharedGroup = create(identity("systemgroup.com.kelva.quorva.shared", QRVContainerClassSystemGroup));
  ASSERT_TRUE(system && group && sharedGroup);
  file(system->url() + "/Library/kept");

  auto urlOf = [&](const QRVMetadataRef& m) {
    QRVError error;
    QRVMetadataRef found = lookup(m->containerIdentity(), &error);
    return found ? found->url() : std::string();
  };
  env_.systemInfo->build = "1A100";
  admin()->rebootQuorvaSetup();
  const std::string rolledSystem = urlOf(system), rolledGroup = urlOf(group);
  EXPECT_NE(rolledSystem, system->url());
  EXPECT_NE(rolledGroup, group->url());
  EXPECT_EQ(urlOf(sharedGroup), sharedGroup->url());
  EXPECT_TRUE(fs::exists(rolledSystem + "/Library/kept"));
  EXPECT_FALSE(fs::exists(system->url()));

  admin()->rebootQuorvaSetup();
  EXPECT_EQ(urlOf(system), rolledSystem) << "the same build again";
  env_.systemInfo->build = "1A200";
  admin()->rebootQuorvaSetup();
  const std::string rolledAgain = urlOf(system);
  EXPECT_NE(rolledAgain, rolledSystem) << "the next build";

  // A status file that cannot be read says nothing about the build: nothing
  // is rolled on a guess, and the rest of the set-up still runs.
  const std::string statusFile =
      env_.services->globalConfiguration->libraryDirectory() + "/qrv_migration_status.plist";
  fs::remove(statusFile);
  fs::create_directories(statusFile);
  const std::string backup = env_.root.path() + "/private/var/mobile/Library/Backup/SystemContainers/Data";
  file(backup + "/com.example.sys/Library/restored");
  env_.systemInfo->build = "1A300";
  QRVLogCapture log(env_.root.path());
  admin()->rebootQuorvaSetup();
  EXPECT_EQ(urlOf(system), rolledAgain);
  EXPECT_TRUE(fs::exists(rolledAgain + "/Library/restored"));
  EXPECT_NE(log.text().find("Error reading system migration file from disk.  This is bad"), std::string::npos);
}

// Only on a multi-user host does the boot sweep group containers that no
// installed application claims.
TEST_F(BootTest, AMultiUserHostSweepsUnclaimedGroupsAtBoot) {
  QRVMetadataRef group = create(identity("group.com.example.unclaimed", QRVContainerClassAppGroup));
  ASSERT_NE(group, nullptr);
  admin()->rebootQuorvaSetup();
  QRVError error;
  EXPECT_NE(lookup(group->containerIdentity(), &error), nullptr) << "a single-user host leaves it to the mapping";

  env_.personas->flags = QRVPersonaService::kMultiUserHostBit;
  admin()->rebootQuorvaSetup();
  EXPECT_EQ(lookup(group->containerIdentity(), &error), nullptr);
  EXPECT_FALSE(fs::exists(group->url()));
}

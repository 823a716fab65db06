// The cleanup of the first start after a device boot: transient containers
// of every kind go, a directory that looks like a container but lost its
// metadata goes, and whatever the daemon cannot recognise as its own stays.
#include <gtest/gtest.h>

#include <filesystem>
#include <future>

#include "base/QRVUUID.h"
#include "support/QRVContainerTest.h"
#include "support/QRVLogCapture.h"

namespace fs = std::filesystem;

namespace {

class BootCleanupTest : public QRVContainerTest {
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

TEST_F(BootCleanupTest, TransientTreesAndOrphansGoWhatIsNotTheDaemonsStays) {
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

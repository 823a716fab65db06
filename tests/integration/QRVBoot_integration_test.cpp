// The real daemon's first start on a root laid out as an older device leaves
// it: system containers restored from a backup (what cannot be restored kept
// aside, links moved as links), transient containers, orphans and staging
// leftovers gone, and what is not the daemon's left alone. Later starts after
// a reboot change nothing on the same build and roll the system containers'
// paths on a new one. The daemon stopped dead in the middle of that boot work
// takes it up again at its next start, with nothing of the backup lost.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <optional>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "base/QRVPlist.h"
#include "base/QRVUUID.h"
#include "client/QRVClient.h"
#include "integration/QRVArmedDaemon.h"
#include "integration/QRVDaemonProcess.h"
#include "integration/QRVRunAs.h"
#include "platform/QRVNotificationService.h"
#include "support/QRVEventually.h"
#include "support/QRVFiles.h"
#include "support/QRVRequests.h"

namespace fs = std::filesystem;

namespace {

constexpr uid_t kInstallerUID = 2302;  // "allowed": unrestricted

constexpr uint64_t kSystemClass = 12;
constexpr uint64_t kSystemGroupClass = 13;
constexpr const char* kMetadataFile = ".com.kelva.quorva.metadata.plist";
constexpr const char* kSharedGroup = "systemgroup.com.kelva.quorva.shared";

// The two users of the device: the personal persona and a work persona with
// its own home.
constexpr const char* kMobileHome = "/private/var/mobile";
constexpr const char* kWorkHome = "/private/var/work";
constexpr const char* kBackupBase = "/private/var/mobile/Library/Backup/SystemContainers";
constexpr const char* kSystemDirectory = "/private/var/containers/Data/System";
constexpr const char* kSystemGroupDirectory = "/private/var/containers/Shared/SystemGroup";
constexpr const char* kBundleDirectory = "/private/var/containers/Bundle/Application";
constexpr const char* kTransientBundles = "/private/var/containers/Temp";
constexpr const char* kCaches = "/private/var/root/Library/Caches/com.kelva.quorvad";
constexpr const char* kDeathRow = "/private/var/root/Library/Caches/com.kelva.quorvad/Dead";
// Outside every container tree: what a link in the backup points at.
constexpr const char* kOutside = "/private/var/outside";
// Where an older layout kept what the first start on this build migrates.
constexpr const char* kOldLogs = "/private/var/mobile/Library/Logs/Quorva";
constexpr const char* kLogs = "/private/var/root/Library/Logs/Quorva";
constexpr const char* kOldBundles = "/private/var/mobile/Containers/Bundle";
constexpr const char* kLibrary = "/private/var/root/Library/Quorva";
constexpr const char* kBundleIdentifier = "com.example.installed";
constexpr const char* kMarkers[] = {"qrv_bundle_migration_complete.plist", "qrv_acl2_migration_complete.plist",
                                    "qrv_group_id_migration_complete.plist",
                                    "qrv_code_signing_migration_complete.plist"};

// One leaf of the backup: a file (its text) or a link (its target) at
// `relative` under the tree `tree` ("Data" or "Shared").
struct BackedUpItem {
  std::string tree;
  std::string relative;
  std::string content;
};

// What an older device carries into its first start under this daemon, and
// what the tests need to remember of it.
struct OlderDevice {
  // Live system containers made by the older system.
  std::string settingsPath, idlePath, sharedGroupPath;
  // Transient trees, orphans and staging leftovers: all of it must go.
  std::vector<std::string> sentenced;
  // Not the daemon's: must stay.
  std::vector<std::string> kept;
  std::vector<BackedUpItem> backup;
  // Children of backed-up containers (each passes the restore once).
  size_t backedUpChildren = 0;
};

size_t occurrences(const std::string& text, const std::string& what) {
  size_t count = 0;
  for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++count;
  return count;
}

void writeFile(const std::string& path, const std::string& text) {
  fs::create_directories(fs::path(path).parent_path());
  QRVWriteText(path, text);
}

// A file's text, a link's target ("-> target"), "dir", or "(nothing)".
std::string describe(const std::string& path) {
  std::error_code ec;
  fs::file_status status = fs::symlink_status(path, ec);
  if (ec || !fs::exists(status)) return "(nothing)";
  if (fs::is_symlink(status)) return "-> " + fs::read_symlink(path).string();
  if (fs::is_directory(status)) return "dir";
  return QRVReadText(path);
}

void writePlist(const std::string& path, const QRVPlist& plist) {
  fs::create_directories(fs::path(path).parent_path());
  QRVPlist::Bytes bytes = plist.toBinary();
  std::ofstream(path, std::ios::binary)
      .write(reinterpret_cast<const char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
}

// A container as an older system made it in `directory`: its directory
// named by its UUID, its metadata file and default subdirectories.
std::string makeContainerIn(const std::string& directory, const std::string& identifier, uint64_t containerClass) {
  const std::string uuid = QRVUUID::random().string();
  const std::string path = directory + "/" + uuid;
  fs::create_directories(path);
  if (containerClass == kSystemClass || containerClass == kSystemGroupClass) fs::create_directories(path + "/Library");
  if (containerClass == kSystemClass) fs::create_directories(path + "/tmp");
  writePlist(path + "/" + kMetadataFile, QRVPlist::dictionary()
                                             .set("QRVMetadataIdentifier", QRVPlist::string(identifier))
                                             .set("QRVMetadataUUID", QRVPlist::string(uuid))
                                             .set("QRVMetadataContentClass", QRVPlist::uinteger(containerClass))
                                             .set("QRVMetadataVersion", QRVPlist::string("2")));
  return path;
}

// A live system container as an older system made it.
std::string makeLiveSystemContainer(const std::string& root, const std::string& identifier, uint64_t containerClass) {
  return makeContainerIn(root + (containerClass == kSystemClass ? kSystemDirectory : kSystemGroupDirectory),
                         identifier, containerClass);
}


// Sets or clears the append-only flag: an append-only file cannot be
// unlinked, even by root, and the daemon's removal only knows how to lift
// the immutable flag.
void setAppendOnly(const std::string& path, bool on) {
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
  ASSERT_GE(fd, 0) << path;
  int flags = 0;
  ASSERT_EQ(ioctl(fd, FS_IOC_GETFLAGS, &flags), 0) << path;
  flags = on ? (flags | FS_APPEND_FL) : (flags & ~FS_APPEND_FL);
  EXPECT_EQ(ioctl(fd, FS_IOC_SETFLAGS, &flags), 0) << path;
  close(fd);
}

// Lifts the append-only flag wherever it is under `root`, so the root can be
// removed.
void releaseAppendOnly(const std::string& root) {
  std::error_code ec;
  for (auto it = fs::recursive_directory_iterator(root, ec); !ec && it != fs::recursive_directory_iterator();
       it.increment(ec)) {
    if (!it->is_regular_file() || it->is_symlink()) continue;
    int fd = open(it->path().c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
    if (fd < 0) continue;
    int flags = 0;
    if (ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0 && (flags & FS_APPEND_FL)) {
      flags &= ~FS_APPEND_FL;
      ioctl(fd, FS_IOC_SETFLAGS, &flags);
    }
    close(fd);
  }
}

// The backup of system containers in the default user's home: containers
// with directories, files and a link out of the tree among their children,
// a plain file and a link where a container directory is expected.
void layOutBackup(const std::string& root, OlderDevice& device) {
  const std::string base = root + kBackupBase;
  auto item = [&](const std::string& tree, const std::string& relative, const std::string& content) {
    writeFile(base + "/" + tree + "/" + relative, content);
    device.backup.push_back({tree, relative, content});
  };
  auto link = [&](const std::string& tree, const std::string& relative, const std::string& target) {
    fs::create_directories(fs::path(base + "/" + tree + "/" + relative).parent_path());
    fs::create_directory_symlink(target, base + "/" + tree + "/" + relative);
    device.backup.push_back({tree, relative, "-> " + target});
  };
  item("Data", "com.example.settings/Library/Preferences/com.example.settings.plist", "restored preferences");
  item("Data", "com.example.settings/Documents/notes/a.txt", "a note");
  item("Data", "com.example.settings/state.db", "backed-up state");
  // The live container's child of this name cannot be removed.
  item("Data", "com.example.settings/Pinned", "backed-up pin");
  link("Data", "com.example.settings/escape", root + kOutside);
  item("Data", "com.example.fresh/a.txt", "fresh");
  item("Data", "com.example.fresh/Library/Caches/c.txt", "cached");
  item("Data", "stray-file", "not a container");
  link("Data", "com.example.linked", root + kOutside);
  item("Shared", "systemgroup.com.example.group/Library/g.txt", "group");
  item("Shared", std::string(kSharedGroup) + "/shared.txt", "shared");
  for (const char* tree : {"Data", "Shared"})
    for (const auto& entry : fs::directory_iterator(base + "/" + tree))
      if (entry.is_directory() && !entry.is_symlink())
        device.backedUpChildren += std::distance(fs::directory_iterator(entry), fs::directory_iterator());
}

// Lays out the daemon's root as an older device leaves it for its first
// start under this daemon: two users, no record of the last build, live
// system containers, a backup to restore, transient containers of every
// tree, orphaned container directories and staging leftovers. Whatever else
// an upgrade from an older release finds on disk joins the picture here.
OlderDevice layOutOlderDevice(QRVDaemonProcess& daemon) {
  const std::string root = daemon.root();
  OlderDevice device;
  daemon.writePersonas({QRVDaemonProcess::persona(1000, 0, "PERSONAL", kMobileHome),
                        QRVDaemonProcess::persona(1001, 1, "WORK", kWorkHome)});
  // What a link in the backup points at; owned and protected so that a walk
  // following the link would show.
  writeFile(root + kOutside + "/secret.txt", "outside");
  chown((root + kOutside).c_str(), 1234, 1234);
  chmod((root + kOutside).c_str(), 0700);
  device.kept.push_back(root + kOutside + "/secret.txt");

  // Live system containers: one the backup replaces children of (one of
  // which cannot be removed), one the backup does not touch, and the shared
  // system group.
  device.settingsPath = makeLiveSystemContainer(root, "com.example.settings", kSystemClass);
  writeFile(device.settingsPath + "/old.txt", "kept");
  writeFile(device.settingsPath + "/state.db", "old state");
  writeFile(device.settingsPath + "/Pinned", "live pin");
  setAppendOnly(device.settingsPath + "/Pinned", true);
  device.idlePath = makeLiveSystemContainer(root, "com.example.idle", kSystemClass);
  writeFile(device.idlePath + "/Library/idle.txt", "idle");
  device.sharedGroupPath = makeLiveSystemContainer(root, kSharedGroup, kSystemGroupClass);
  writeFile(device.sharedGroupPath + "/existing.txt", "existing");

  layOutBackup(root, device);

  auto sentence = [&](const std::string& path) {
    writeFile(path + "/Library/leftover", "leftover");
    device.sentenced.push_back(path);
  };
  for (const char* home : {kMobileHome, kWorkHome}) {
    const std::string containers = root + home + "/Containers";
    sentence(containers + "/Temp/Data/Application/" + QRVUUID::random().string());
    sentence(containers + "/Data/Application/" + QRVUUID::random().string());
    sentence(containers + "/Staging/" + QRVUUID::random().string());
  }
  sentence(root + kCaches + "/Temp/Data/System/" + QRVUUID::random().string());
  sentence(root + kTransientBundles + "/Bundle/Application/" + QRVUUID::random().string());
  sentence(root + kSystemDirectory + "/" + QRVUUID::random().string());
  sentence(root + kCaches + "/Staging/" + QRVUUID::random().string());
  // What the first start on this build migrates: the log in the user's home
  // (one file too old to keep on a customer image), the bundle tree in the
  // user's home (an installed application, and an orphan without metadata
  // that the cleanup then finds in its new place), the marker files of
  // completed migrations. No build is recorded yet.
  writeFile(root + kOldLogs + "/quorvad.log", "current");
  writeFile(root + kOldLogs + "/quorvad.log.0", "previous");
  writeFile(root + kOldLogs + "/quorvad.log.1", "older");
  writeFile(makeContainerIn(root + kOldBundles + "/Application", kBundleIdentifier, 1) + "/App.app/binary", "app");
  sentence(root + kOldBundles + "/Application/" + QRVUUID::random().string());
  for (const char* marker : kMarkers)
    writePlist(root + kLibrary + "/" + marker,
               QRVPlist::dictionary().set("QRVMigrationVersionNumber", QRVPlist::string("OLD1")));
  // Not a container's name: someone else's.
  writeFile(root + kMobileHome + "/Containers/Data/Application/notes/readme.txt", "mine");
  device.kept.push_back(root + kMobileHome + "/Containers/Data/Application/notes/readme.txt");
  return device;
}

// Live containers of a system class on disk, by identifier; every one of
// them is expected once.
std::map<std::string, std::string> liveContainersOnDisk(const std::string& root, uint64_t containerClass) {
  std::map<std::string, std::string> live;
  const std::string directory = root + (containerClass == kSystemClass ? kSystemDirectory : kSystemGroupDirectory);
  if (!fs::exists(directory)) return live;
  for (const auto& entry : fs::directory_iterator(directory)) {
    std::ifstream in(entry.path() / kMetadataFile, std::ios::binary);
    if (!in) continue;
    const std::string bytes((std::istreambuf_iterator<char>(in)), {});
    std::optional<QRVPlist> metadata =
        QRVPlist::fromBytes(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size());
    if (!metadata || !metadata->isDictionary()) {
      ADD_FAILURE() << "unreadable metadata in " << entry.path();
      continue;
    }
    const std::string identifier = metadata->stringForKey("QRVMetadataIdentifier");
    auto [it, first] = live.emplace(identifier, entry.path().string());
    EXPECT_TRUE(first) << identifier << " is live twice: " << it->second << " and " << entry.path();
  }
  return live;
}

// Where a backed-up item is now: still in the backup (before or during its
// restore), live in its container, or kept aside as not restorable. Nothing
// when it is nowhere, or nowhere with its content.
std::optional<std::string> whereIs(const std::string& root, const BackedUpItem& item) {
  const std::string tree = root + kBackupBase + "/" + item.tree;
  for (const char* state : {"", ".inprogress", ".failed"})
    if (describe(tree + state + "/" + item.relative) == item.content) return tree + state + "/" + item.relative;
  const size_t slash = item.relative.find('/');
  if (slash == std::string::npos) return std::nullopt;
  const std::map<std::string, std::string> live =
      liveContainersOnDisk(root, item.tree == "Data" ? kSystemClass : kSystemGroupClass);
  auto container = live.find(item.relative.substr(0, slash));
  if (container == live.end()) return std::nullopt;
  const std::string path = container->second + item.relative.substr(slash);
  if (describe(path) == item.content) return path;
  return std::nullopt;
}

void expectNothingOfTheBackupLost(const std::string& root, const OlderDevice& device) {
  for (const BackedUpItem& item : device.backup)
    EXPECT_TRUE(whereIs(root, item).has_value()) << item.tree << "/" << item.relative << " is lost";
}

// Every path under `root` with its kind (and a link's target), without what
// changes on every start whatever the boot work does: the socket and the log.
QRVListing listing(const std::string& root) {
  QRVListing out;
  for (auto it = fs::recursive_directory_iterator(root); it != fs::recursive_directory_iterator(); ++it) {
    const std::string relative = it->path().string().substr(root.size());
    if (relative == "/run" || relative == "/private/var/root/Library/Logs") {
      it.disable_recursion_pending();
      continue;
    }
    out[relative] =
        it->is_symlink() ? "-> " + fs::read_symlink(it->path()).string() : (it->is_directory() ? "dir" : "file");
  }
  return out;
}

class BootIntegrationTest : public testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root: clients run under other uids";
    daemon_.trustUID(kInstallerUID, "com.example.installer", QRVEntitlements({"allowed"}));
    device_ = layOutOlderDevice(daemon_);
  }
  void TearDown() override {
    daemon_.stop();
    releaseAppendOnly(daemon_.root());
  }

  std::string root() const { return daemon_.root(); }

  // Sets `key` of the root's os-release, which names the build and whether
  // the image is an internal one.
  void setOsRelease(const std::string& key, const std::string& value) {
    std::istringstream in(QRVReadText(root() + "/etc/os-release"));
    std::string out;
    for (std::string line; std::getline(in, line);)
      if (line.rfind(key + "=", 0) != 0) out += line + "\n";
    QRVWriteText(root() + "/etc/os-release", out + key + "=" + value + "\n");
  }
  std::string cleanupNotice() const { return root() + "/run/quorva/notify/" + kCleanupCompleteNotification; }

  // Starts the daemon and waits until the work of its start, the
  // asynchronous cleanups included, is done.
  void startAndWaitForBootWork() {
    fs::remove(cleanupNotice());
    daemon_.start();
    ASSERT_TRUE(daemon_.isRunning());
    EXPECT_TRUE(QRVEventually([&] { return fs::exists(cleanupNotice()); }, std::chrono::seconds(10)))
        << "the start-up cleanup did not finish";
    EXPECT_TRUE(QRVEventually([&] { return QRVEntriesIn(root() + kDeathRow) == 0; }, std::chrono::seconds(10)))
        << "death row was not emptied";
  }

  // A system container looked up through the daemon: its path, or "" when
  // there is none.
  std::string lookUp(const std::string& identifier, uint64_t containerClass) {
    QRVPlist reply = QRVRepliesAs(daemon_, kInstallerUID,
                                  {QRVCreateRequest(identifier, containerClass, /*transient=*/false,
                                                    /*createIfNecessary=*/false)})[0];
    if (QRVClient::resultCode(reply) != 1) return "";
    return reply.stringForKey("ReplyPath");
  }

  // The state the first start leaves, whether or not its boot work was cut
  // short on the way.
  void expectOlderDeviceSetUp(bool internalImage) {
    const std::string settings = lookUp("com.example.settings", kSystemClass);
    ASSERT_NE(settings, "");
    EXPECT_EQ(describe(settings + "/Library/Preferences/com.example.settings.plist"), "restored preferences");
    EXPECT_EQ(describe(settings + "/Documents/notes/a.txt"), "a note");
    EXPECT_EQ(describe(settings + "/state.db"), "backed-up state") << "a restored child replaces the live one";
    EXPECT_EQ(describe(settings + "/old.txt"), "kept") << "what the backup does not hold stays";
    EXPECT_EQ(describe(settings + "/Pinned"), "live pin");
    EXPECT_EQ(describe(settings + "/escape"), "-> " + root() + kOutside) << "a link is moved as a link";
    EXPECT_TRUE(fs::exists(settings + "/tmp")) << "the default structure is made again";
    const std::string fresh = lookUp("com.example.fresh", kSystemClass);
    ASSERT_NE(fresh, "");
    EXPECT_EQ(describe(fresh + "/a.txt"), "fresh");
    EXPECT_EQ(describe(fresh + "/Library/Caches/c.txt"), "cached");
    const std::string group = lookUp("systemgroup.com.example.group", kSystemGroupClass);
    ASSERT_NE(group, "");
    EXPECT_EQ(describe(group + "/Library/g.txt"), "group");
    EXPECT_EQ(lookUp(kSharedGroup, kSystemGroupClass), device_.sharedGroupPath) << "the shared group keeps its path";
    EXPECT_EQ(describe(device_.sharedGroupPath + "/shared.txt"), "shared");
    EXPECT_EQ(describe(device_.sharedGroupPath + "/existing.txt"), "existing");
    // No record of the last build: the first start is an upgrade, and the
    // containers the older system made are rolled to new paths.
    const std::string idle = lookUp("com.example.idle", kSystemClass);
    ASSERT_NE(idle, "");
    EXPECT_NE(idle, device_.idlePath);
    EXPECT_NE(settings, device_.settingsPath);
    EXPECT_FALSE(fs::exists(device_.idlePath));
    EXPECT_FALSE(fs::exists(device_.settingsPath));
    EXPECT_EQ(describe(idle + "/Library/idle.txt"), "idle");
    EXPECT_EQ(lookUp("com.example.linked", kSystemClass), "") << "a link in place of a container is not followed";

    // Of the backup only what could not be restored is left, and all of it.
    // An internal image keeps the backup's trees for inspection, emptied of
    // what was restored.
    const std::string base = root() + kBackupBase;
    std::map<std::string, std::string> left;
    for (auto it = fs::recursive_directory_iterator(base); it != fs::recursive_directory_iterator(); ++it)
      left[it->path().string().substr(base.size())] = describe(it->path().string());
    std::map<std::string, std::string> expected = {
        {"/Data.failed", "dir"},
        {"/Data.failed/com.example.linked", "-> " + root() + kOutside},
        {"/Data.failed/com.example.settings", "dir"},
        {"/Data.failed/com.example.settings/Pinned", "backed-up pin"},
        {"/Data.failed/stray-file", "not a container"},
    };
    if (internalImage)
      for (const char* emptied :
           {"/Data.inprogress", "/Data.inprogress/com.example.fresh", "/Data.inprogress/com.example.settings",
            "/Shared.inprogress", "/Shared.inprogress/systemgroup.com.example.group",
            "/Shared.inprogress/systemgroup.com.kelva.quorva.shared"})
        expected[emptied] = "dir";
    EXPECT_EQ(left, expected);
    expectNothingOfTheBackupLost(root(), device_);

    // The older layout's leftovers are migrated: the newest log files kept
    // one number older, the bundle tree in its place, the markers folded
    // into the status file.
    EXPECT_EQ(describe(root() + kLogs + "/quorvad.1"), "current");
    EXPECT_EQ(describe(root() + kLogs + "/quorvad.log.1"), "previous");
    EXPECT_EQ(describe(root() + kLogs + "/quorvad.log.2"), internalImage ? "older" : "(nothing)");
    EXPECT_FALSE(fs::exists(root() + kOldLogs));
    const std::string bundle = lookUp(kBundleIdentifier, 1);
    EXPECT_EQ(bundle.rfind(root() + kBundleDirectory + "/", 0), 0u) << bundle;
    EXPECT_EQ(describe(bundle + "/App.app/binary"), "app");
    EXPECT_FALSE(fs::exists(root() + kOldBundles));
    for (const char* marker : kMarkers) EXPECT_FALSE(fs::exists(root() + kLibrary + "/" + marker)) << marker;

    // What the links point at is untouched.
    struct stat st {};
    ASSERT_EQ(stat((root() + kOutside).c_str(), &st), 0);
    EXPECT_EQ(st.st_uid, 1234u);
    EXPECT_EQ(st.st_mode & 07777, 0700u);
    EXPECT_EQ(QRVEntriesIn(root() + kOutside), 1u);

    // Gone from where they were and not moved anywhere else either: death
    // row removed them.
    for (const std::string& path : device_.sentenced) EXPECT_FALSE(fs::exists(path)) << path << " is still there";
    for (const auto& entry : fs::recursive_directory_iterator(root()))
      EXPECT_NE(entry.path().filename(), "leftover") << entry.path() << " survived";
    for (const std::string& path : device_.kept) EXPECT_TRUE(fs::exists(path)) << path << " is gone";
    EXPECT_EQ(QRVEntriesIn(root() + kDeathRow), 0u);
  }

  QRVDaemonProcess daemon_;
  OlderDevice device_;
};

}  // namespace

TEST_F(BootIntegrationTest, AnOlderDeviceIsSetUpAtItsFirstStartAndLeftAsItIsAtTheNextBoot) {
  setOsRelease("VARIANT_ID", "customer");
  startAndWaitForBootWork();
  expectOlderDeviceSetUp(/*internalImage=*/false);
  EXPECT_TRUE(daemon_.bootWorkRecorded());
  const std::string log = daemon_.readLog();
  EXPECT_NE(log.find("Deleting orphaned data missing a metadata file at: " + device_.sentenced[1]), std::string::npos);
  EXPECT_NE(log.find("Failed to remove destination com.example.settings:"), std::string::npos);

  // The same build after a reboot: the boot work runs again and finds
  // nothing to do.
  daemon_.stop();
  const auto before = listing(root());
  daemon_.simulateReboot();
  const size_t logSize = daemon_.readLog().size();
  startAndWaitForBootWork();
  EXPECT_NE(daemon_.readLog().find("quorvad performing first boot initialization", logSize), std::string::npos);
  daemon_.stop();
  // The first boot sent the transient trees to death row whole; the
  // configuration makes them again, empty, when the next start asks for them.
  std::string remade;
  for (const std::string& tree : {std::string(kTransientBundles), std::string(kMobileHome) + "/Containers/Temp",
                                  std::string(kCaches) + "/Temp", std::string(kWorkHome) + "/Containers/Temp"}) {
    remade += "new: " + tree + "\n";
    EXPECT_EQ(QRVEntriesIn(root() + tree), 0u) << tree;
  }
  EXPECT_EQ(QRVListingDifferences(before, listing(root())), remade);
  const std::string everything = daemon_.readLog();
  for (const char* once : {"Migrating from many marker files down to one", "Migrated log files on",
                           "Moving bundle containers from user to system location"})
    EXPECT_EQ(occurrences(everything, once), 1u) << once;
}

TEST_F(BootIntegrationTest, ANewBuildRollsSystemContainerPathsOnceExceptTheSharedGroups) {
  setOsRelease("VARIANT_ID", "customer");
  startAndWaitForBootWork();
  struct Container {
    std::string identifier;
    uint64_t containerClass;
    std::string path;
  };
  std::vector<Container> containers = {{"com.example.settings", kSystemClass, ""},
                                       {"com.example.fresh", kSystemClass, ""},
                                       {"com.example.idle", kSystemClass, ""},
                                       {"systemgroup.com.example.group", kSystemGroupClass, ""},
                                       {kSharedGroup, kSystemGroupClass, ""}};
  for (Container& c : containers) {
    c.path = lookUp(c.identifier, c.containerClass);
    ASSERT_NE(c.path, "") << c.identifier;
  }
  daemon_.stop();
  std::map<std::string, QRVListing> contents;
  for (const Container& c : containers) contents[c.identifier] = listing(c.path);

  // A new build after a reboot.
  setOsRelease("BUILD_ID", "dev.2");
  daemon_.simulateReboot();
  startAndWaitForBootWork();
  for (Container& c : containers) {
    SCOPED_TRACE(c.identifier);
    const std::string rolled = lookUp(c.identifier, c.containerClass);
    ASSERT_NE(rolled, "");
    if (c.identifier == kSharedGroup) {
      EXPECT_EQ(rolled, c.path);
    } else {
      EXPECT_NE(rolled, c.path);
      EXPECT_FALSE(fs::exists(c.path));
    }
    EXPECT_EQ(QRVListingDifferences(contents[c.identifier], listing(rolled)), "")
        << "the contents move with the container";
    c.path = rolled;
  }
  for (uint64_t containerClass : {kSystemClass, kSystemGroupClass})
    EXPECT_EQ(liveContainersOnDisk(root(), containerClass).size(), containerClass == kSystemClass ? 3u : 2u);

  // A further reboot on that build rolls nothing.
  daemon_.stop();
  const auto before = listing(root());
  daemon_.simulateReboot();
  startAndWaitForBootWork();
  for (const Container& c : containers) EXPECT_EQ(lookUp(c.identifier, c.containerClass), c.path) << c.identifier;
  daemon_.stop();
  EXPECT_EQ(QRVListingDifferences(before, listing(root())), "");
}

// Stopped dead after each child the restore moves, one start after another:
// every start takes the restore up where the last one stood, no child is
// ever lost or restored twice, and the start that gets through leaves what
// an uninterrupted one would.
TEST_F(BootIntegrationTest, ARestoreKilledAfterAnyChildIsTakenUpAtTheNextStartWithNothingLost) {
  size_t kills = 0;
  for (;;) {
    fs::remove(cleanupNotice());
    QRVStartArmed(daemon_, "boot.restore-child-moved");
    if (daemon_.isRunning()) break;
    SCOPED_TRACE("kill " + std::to_string(kills));
    QRVExpectStoppedDead(daemon_);
    EXPECT_FALSE(daemon_.bootWorkRecorded()) << "a boot whose work was cut short is recorded as done";
    expectNothingOfTheBackupLost(root(), device_);
    ASSERT_LE(++kills, device_.backedUpChildren) << "the restore does not get on";
  }
  EXPECT_EQ(kills, device_.backedUpChildren) << "each child passes the restore once";
  EXPECT_TRUE(QRVEventually([&] { return fs::exists(cleanupNotice()); }, std::chrono::seconds(10)));
  EXPECT_TRUE(QRVEventually([&] { return QRVEntriesIn(root() + kDeathRow) == 0; }, std::chrono::seconds(10)));
  expectOlderDeviceSetUp(/*internalImage=*/true);
  EXPECT_TRUE(daemon_.bootWorkRecorded());
}

// Stopped dead after the first system container of the roll: the next start
// rolls again, and every system container is live once, its contents kept.
TEST_F(BootIntegrationTest, AUUIDRollKilledMidwayIsFinishedAtTheNextStart) {
  QRVStartArmed(daemon_, "boot.uuid-rolled");
  QRVExpectStoppedDead(daemon_);
  EXPECT_FALSE(daemon_.bootWorkRecorded());
  const std::map<std::string, std::string> live = liveContainersOnDisk(root(), kSystemClass);
  EXPECT_EQ(live.size(), 2u);
  EXPECT_NE(fs::exists(device_.settingsPath), fs::exists(device_.idlePath)) << "one container is rolled, the other not";
  for (const auto& [identifier, path] : live) {
    EXPECT_EQ(describe(path + (identifier == "com.example.idle" ? "/Library/idle.txt" : "/old.txt")),
              identifier == "com.example.idle" ? "idle" : "kept");
  }
  expectNothingOfTheBackupLost(root(), device_);

  startAndWaitForBootWork();
  expectOlderDeviceSetUp(/*internalImage=*/true);
  EXPECT_EQ(liveContainersOnDisk(root(), kSystemClass).size(), 3u);
  EXPECT_EQ(liveContainersOnDisk(root(), kSystemGroupClass).size(), 2u);
  EXPECT_TRUE(daemon_.bootWorkRecorded());
}

// A later backup whose children cannot be restored either, under the names
// that earlier failures already hold in the failed-items tree: the earlier
// ones are not replaced and the later ones are not lost when the backup
// goes.
TEST_F(BootIntegrationTest, FailuresOfALaterRestoreAreKeptBesideEarlierOnes) {
  setOsRelease("VARIANT_ID", "customer");
  startAndWaitForBootWork();
  daemon_.stop();
  const std::string data = root() + kBackupBase + "/Data";
  ASSERT_EQ(describe(data + ".failed/com.example.settings/Pinned"), "backed-up pin");
  ASSERT_EQ(describe(data + ".failed/stray-file"), "not a container");
  // The live container's "Pinned" still cannot be removed; this time the
  // backup holds a directory of that name.
  writeFile(data + "/com.example.settings/Pinned/inner.txt", "second pin");
  writeFile(data + "/stray-file", "second stray");
  daemon_.simulateReboot();
  startAndWaitForBootWork();

  std::multiset<std::string> failed;
  for (const auto& entry : fs::recursive_directory_iterator(data + ".failed"))
    if (entry.is_regular_file()) failed.insert(QRVReadText(entry.path().string()));
  EXPECT_EQ(failed, (std::multiset<std::string>{"backed-up pin", "not a container", "second pin", "second stray"}));
  EXPECT_FALSE(fs::exists(data));
  EXPECT_FALSE(fs::exists(data + ".inprogress"));
}

// Stopped dead after each old log file moved, then after the bundle tree
// moved: every start takes the upgrade migration up again, nothing of the
// log or the bundles is lost or moved twice, and the start that gets
// through leaves what an uninterrupted one would.
TEST_F(BootIntegrationTest, AnUpgradeMigrationKilledAfterAnyMoveIsFinishedAtTheNextStart) {
  const std::vector<std::string> oldNames = {"quorvad.log", "quorvad.log.0", "quorvad.log.1"};
  for (size_t kills = 1; kills <= oldNames.size(); ++kills) {
    SCOPED_TRACE("kill " + std::to_string(kills));
    QRVStartArmed(daemon_, "migration.log-moved");
    QRVExpectStoppedDead(daemon_);
    EXPECT_FALSE(daemon_.bootWorkRecorded());
    EXPECT_EQ(QRVEntriesIn(root() + kOldLogs), oldNames.size() - kills);
    EXPECT_EQ(QRVEntriesIn(root() + kLogs) - (fs::exists(root() + kLogs + "/quorvad.log") ? 1 : 0), kills);
  }
  QRVStartArmed(daemon_, "migration.bundles-relocated");
  QRVExpectStoppedDead(daemon_);
  EXPECT_FALSE(fs::exists(root() + kOldLogs));
  EXPECT_FALSE(fs::exists(root() + kOldBundles));
  EXPECT_EQ(QRVEntriesIn(root() + kBundleDirectory), 2u) << "the application and the orphan, moved whole";

  startAndWaitForBootWork();
  expectOlderDeviceSetUp(/*internalImage=*/true);
  EXPECT_TRUE(daemon_.bootWorkRecorded());
}

// Command 30 stopped dead after the first user's subdirectories: the next
// request does them all and records the migration; the one after that does
// nothing more.
TEST_F(BootIntegrationTest, APerUserMigrationKilledAfterOneUserIsFinishedByTheNextRequest) {
  startAndWaitForBootWork();
  QRVPlist made = QRVRepliesAs(daemon_, kInstallerUID,
                               {QRVCreateRequest("com.example.app", 2)
                                    .set("PersonaUniqueString", QRVPlist::string("WORK"))})[0];
  ASSERT_EQ(QRVClient::resultCode(made), 1u) << made.description();
  const std::string caches = made.stringForKey("ReplyPath") + "/Library/Caches";
  ASSERT_TRUE(fs::is_directory(caches)) << caches;
  fs::remove(caches);
  daemon_.stop();

  QRVStartArmed(daemon_, "migration.user-subdirectories-made");
  QRVExpectStoppedDeadBy(daemon_, kInstallerUID, QRVRequest(30));
  const std::string status = root() + kMobileHome + "/Library/Quorva/qrv_user_migration_status.plist";
  EXPECT_FALSE(fs::exists(status)) << "recorded although cut short";

  daemon_.start();
  QRVPlist reply = QRVRepliesAs(daemon_, kInstallerUID, {QRVRequest(30)})[0];
  EXPECT_EQ(QRVClient::resultCode(reply), 1u) << reply.description();
  EXPECT_TRUE(fs::is_directory(caches)) << caches;
  EXPECT_EQ(occurrences(daemon_.readLog(), "Completed Per User Subdirectory Migration for"), 3u)
      << "one user before the kill, both after it";
  const std::string bytes = QRVReadText(status);
  std::optional<QRVPlist> recorded = QRVPlist::fromBinary(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size());
  ASSERT_TRUE(recorded.has_value());
  EXPECT_NE(recorded->get("SubdirectoryMigration"), nullptr);

  fs::remove(caches);
  reply = QRVRepliesAs(daemon_, kInstallerUID, {QRVRequest(30)})[0];
  EXPECT_EQ(QRVClient::resultCode(reply), 1u);
  EXPECT_FALSE(fs::exists(caches)) << "recorded: never again";
}

// Stops the real daemon dead (as a power loss would) at each step of creating
// a container, replacing or wiping one and emptying death row, restarts it,
// and checks what the next start leaves: whole containers or none, no journal,
// empty staging and death row, and nothing else in the root changed. Also
// recovers replace journals written by hand in each state a replace can be
// caught in.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <random>
#include <thread>

#include "client/QRVClient.h"
#include "integration/QRVArmedDaemon.h"
#include "integration/QRVDaemonProcess.h"
#include "integration/QRVRunAs.h"
#include "support/QRVEventually.h"
#include "support/QRVFiles.h"
#include "support/QRVRequests.h"

namespace fs = std::filesystem;

namespace {

constexpr uid_t kInstallerUID = 2102;  // "allowed": unrestricted

constexpr const char* kMetadataFile = ".com.kelva.quorva.metadata.plist";
constexpr const char* kDataClassDirectory = "/private/var/mobile/Containers/Data/Application";
constexpr const char* kTransientDirectory = "/private/var/mobile/Containers/Temp";
constexpr const char* kUserStaging = "/private/var/mobile/Containers/Staging";
constexpr const char* kCaches = "/private/var/root/Library/Caches/com.kelva.quorvad";
constexpr const char* kReplaceDirectory = "/private/var/root/Library/Quorva/Replace";

// The data container of `identifier`, looked up but never created.
QRVPlist lookupRequest(const std::string& identifier) {
  return QRVCreateRequest(identifier, 2, /*transient=*/false, /*createIfNecessary=*/false);
}

bool isEmptyOrAbsent(const std::string& path) { return !fs::exists(path) || fs::is_empty(path); }

// Everything under the root that a crash and the recovery must leave alone:
// relative path -> kind, mode, owner and, for files, the contents.
using Snapshot = QRVListing;

Snapshot snapshotOf(const std::string& root, const std::vector<std::string>& skipped) {
  // What the daemon rightly changes on every start (its socket, its log) and
  // where crashed work may linger (staging, death row, the journals).
  std::vector<std::string> skip = {"/run", "/private/var/root/Library/Logs", kUserStaging, kCaches,
                                   kReplaceDirectory};
  skip.insert(skip.end(), skipped.begin(), skipped.end());
  Snapshot snapshot;
  for (auto it = fs::recursive_directory_iterator(root); it != fs::recursive_directory_iterator(); ++it) {
    std::string relative = it->path().string().substr(root.size());
    if (std::any_of(skip.begin(), skip.end(), [&](const std::string& s) { return relative.rfind(s, 0) == 0; })) {
      if (it->is_directory() && !it->is_symlink()) it.disable_recursion_pending();
      continue;
    }
    struct stat st {};
    lstat(it->path().c_str(), &st);
    std::string entry = std::to_string(st.st_mode) + " " + std::to_string(st.st_uid) + ":" + std::to_string(st.st_gid);
    if (S_ISREG(st.st_mode)) {
      std::ifstream in(it->path(), std::ios::binary);
      entry += " " + std::to_string(std::hash<std::string>()(std::string(std::istreambuf_iterator<char>(in), {})));
    }
    snapshot[relative] = entry;
  }
  return snapshot;
}

// A daemon on a fresh root that trusts the installer with every command.
void trustInstaller(QRVDaemonProcess& daemon) {
  daemon.trustUID(kInstallerUID, "com.example.installer",
                  QRVPlist::dictionary().set("com.kelva.private.Quorva.allowed", QRVPlist::boolean(true)));
}

// Restarts the daemon after a crash and waits until the start-up cleanup has
// emptied staging and death row.
void restartAndExpectCleanedUp(QRVDaemonProcess& daemon) {
  daemon.start();
  const std::string root = daemon.root();
  EXPECT_TRUE(QRVEventually([&] {
    return isEmptyOrAbsent(root + kUserStaging) && isEmptyOrAbsent(root + kCaches + "/Staging") &&
           isEmptyOrAbsent(root + kCaches + "/Dead");
  })) << "staging or death row still holds something";
  EXPECT_TRUE(isEmptyOrAbsent(root + kReplaceDirectory)) << "a replace journal survived the recovery";
}

}  // namespace

// Each step of a replace (command 2), and of a wipe (command 12, a replace
// that keeps the UUID): exactly one whole container is live afterwards.
TEST(CrashIntegrationTest, AReplaceKilledAtAnyStepLeavesOneWholeContainer) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root: clients run under other uids";
  for (const char* point : {"replace.journal-written", "replace.old-parked", "replace.new-placed",
                            "replace.cache-updated", "replace.staging-removed"}) {
    for (bool wipe : {false, true}) {
      SCOPED_TRACE(std::string(point) + (wipe ? " (wipe)" : " (replace)"));
      QRVDaemonProcess daemon;
      trustInstaller(daemon);
      daemon.start();
      std::vector<QRVPlist> made = QRVRepliesAs(
          daemon, kInstallerUID,
          {QRVCreateRequest("com.example.r", 2), QRVCreateRequest("com.example.r", 2, /*transient=*/true), QRVCreateRequest("com.example.o", 2)});
      for (const QRVPlist& reply : made) ASSERT_EQ(QRVClient::resultCode(reply), 1u);
      const std::string oldPath = made[0].stringForKey("ReplyPath"), newPath = made[1].stringForKey("ReplyPath");
      const QRVPlist::Bytes oldUUID = made[0].dataForKey("ReplyUUID"), newUUID = made[1].dataForKey("ReplyUUID");
      QRVWriteText(oldPath + "/old.txt", "old");
      QRVWriteText(newPath + "/new.txt", "new");
      QRVWriteText(made[2].stringForKey("ReplyPath") + "/other.txt", "other");
      daemon.stop();
      // The two containers of the swap, and in a wipe the transient tree:
      // a wipe stopped before its swap leaves the fresh transient container
      // it made, whole, for the next boot's cleanup of transient containers.
      std::vector<std::string> involved = {oldPath.substr(daemon.root().size()),
                                           newPath.substr(daemon.root().size())};
      if (wipe) involved.push_back(kTransientDirectory);
      const Snapshot before = snapshotOf(daemon.root(), involved);

      QRVStartArmed(daemon, point);
      QRVExpectStoppedDeadBy(daemon, kInstallerUID,
              wipe ? QRVRequest(12)
                          .set("Identifier", QRVPlist::string("com.example.r"))
                          .set("ContainerClass", QRVPlist::uinteger(2))
                    : QRVRequest(2)
                          .set("OldIdentifier", QRVPlist::string("com.example.r"))
                          .set("OldContainerClass", QRVPlist::uinteger(2))
                          .set("OldContainerUUID", QRVPlist::data(oldUUID))
                          .set("NewIdentifier", QRVPlist::string("com.example.r"))
                          .set("NewContainerClass", QRVPlist::uinteger(2))
                          .set("NewContainerUUID", QRVPlist::data(newUUID)));
      restartAndExpectCleanedUp(daemon);

      QRVPlist found = QRVRepliesAs(daemon, kInstallerUID, {lookupRequest("com.example.r")})[0];
      ASSERT_EQ(QRVClient::resultCode(found), 1u);
      const std::string live = found.stringForKey("ReplyPath");
      const bool isOld = fs::exists(live + "/old.txt");
      const bool isNew = wipe ? !isOld : fs::exists(live + "/new.txt");
      EXPECT_NE(isOld, isNew) << live;
      EXPECT_TRUE(fs::exists(live + "/" + kMetadataFile));
      if (isOld || wipe) {
        EXPECT_EQ(live, oldPath);
        EXPECT_EQ(found.dataForKey("ReplyUUID"), oldUUID);
      } else {
        EXPECT_EQ(found.dataForKey("ReplyUUID"), newUUID);
        EXPECT_FALSE(fs::exists(oldPath));
      }
      // One container of the replaced identifier and the bystander: no
      // half-moved copy lies anywhere in the class directory.
      size_t containers = 0;
      for (const auto& entry : fs::directory_iterator(daemon.root() + kDataClassDirectory)) {
        EXPECT_TRUE(fs::exists(entry.path() / kMetadataFile)) << entry.path();
        containers++;
      }
      EXPECT_EQ(containers, 2u);
      involved.push_back(live.substr(daemon.root().size()));
      EXPECT_EQ(QRVListingDifferences(before, snapshotOf(daemon.root(), involved)), "");
    }
  }
}

// Each step of creating a container: it is whole and live, or not there.
TEST(CrashIntegrationTest, ACreationKilledAtAnyStepLeavesAWholeContainerOrNone) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root: clients run under other uids";
  for (const char* point : {"create.staged", "create.metadata-written", "create.live"}) {
    SCOPED_TRACE(point);
    QRVDaemonProcess daemon;
    trustInstaller(daemon);
    QRVStartArmed(daemon, point);
    QRVExpectStoppedDeadBy(daemon, kInstallerUID, QRVCreateRequest("com.example.c", 2));
    restartAndExpectCleanedUp(daemon);

    QRVPlist found = QRVRepliesAs(daemon, kInstallerUID, {lookupRequest("com.example.c")})[0];
    size_t live = 0;
    for (const auto& entry : fs::directory_iterator(daemon.root() + kDataClassDirectory)) {
      live++;
      EXPECT_TRUE(fs::exists(entry.path() / kMetadataFile)) << entry.path();
    }
    if (std::string(point) == "create.live") {
      EXPECT_EQ(QRVClient::resultCode(found), 1u);
      EXPECT_EQ(live, 1u);
    } else {
      // Only staging saw the half-built container.
      EXPECT_EQ(QRVClient::resultCode(found), 21u);
      EXPECT_EQ(live, 0u);
    }
  }
}

// Emptying death row stopped after its first item: the next start finishes
// the job, and the container that was never staged is untouched.
TEST(CrashIntegrationTest, DeathRowEmptyingKilledHalfwayIsFinishedAtTheNextStart) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root: clients run under other uids";
  QRVDaemonProcess daemon;
  trustInstaller(daemon);
  // Death row is empty when this daemon starts, so its start-up cleanup
  // passes no crash point; command 4 below does.
  QRVStartArmed(daemon, "deathrow.item-removed");
  std::vector<QRVPlist> made = QRVRepliesAs(
      daemon, kInstallerUID, {QRVCreateRequest("com.example.a", 2), QRVCreateRequest("com.example.b", 2), QRVCreateRequest("com.example.k", 2)});
  for (const QRVPlist& reply : made) ASSERT_EQ(QRVClient::resultCode(reply), 1u);
  QRVWriteText(made[2].stringForKey("ReplyPath") + "/kept.txt", "kept");
  QRVPlist::Array classes, uuids, identifiers, personas;
  for (int i = 0; i < 2; i++) {
    classes.push_back(QRVPlist::uinteger(2));
    uuids.push_back(QRVPlist::data(made[i].dataForKey("ReplyUUID")));
    identifiers.push_back(QRVPlist::string(i == 0 ? "com.example.a" : "com.example.b"));
    personas.push_back(QRVPlist::string(""));
  }
  QRVPlist staged = QRVRepliesAs(daemon, kInstallerUID,
                                 {QRVRequest(3)
                                      .set("ContainerClassesArray", QRVPlist::array(classes))
                                      .set("UUIDsArray", QRVPlist::array(uuids))
                                      .set("IdentifiersArray", QRVPlist::array(identifiers))
                                      .set("PersonaUniqueStringsArray", QRVPlist::array(personas))})[0];
  ASSERT_EQ(QRVClient::resultCode(staged), 1u);
  const std::string deathRow = daemon.root() + kCaches + "/Dead";
  ASSERT_EQ(std::distance(fs::directory_iterator(deathRow), fs::directory_iterator()), 2);
  const Snapshot before = snapshotOf(daemon.root(), {});

  QRVExpectStoppedDeadBy(daemon, kInstallerUID, QRVRequest(4));
  EXPECT_EQ(std::distance(fs::directory_iterator(deathRow), fs::directory_iterator()), 1)
      << "the daemon should have stopped after the first item";

  restartAndExpectCleanedUp(daemon);
  std::vector<QRVPlist> found = QRVRepliesAs(
      daemon, kInstallerUID,
      {lookupRequest("com.example.a"), lookupRequest("com.example.b"), lookupRequest("com.example.k")});
  EXPECT_EQ(QRVClient::resultCode(found[0]), 21u);
  EXPECT_EQ(QRVClient::resultCode(found[1]), 21u);
  EXPECT_EQ(QRVClient::resultCode(found[2]), 1u);
  EXPECT_EQ(QRVListingDifferences(before, snapshotOf(daemon.root(), {})), "");
}

// Journals written by hand in each state a replace can be caught in: the
// next start finishes or rolls back each one, and the container it ends with
// is whole, with its metadata.
TEST(CrashIntegrationTest, HandWrittenJournalsOfEachStateAreRecoveredAtTheNextStart) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root: clients run under other uids";
  enum State { kNotStarted, kOldInStaging, kNewAtDestination, kFinished };
  for (State state : {kNotStarted, kOldInStaging, kNewAtDestination, kFinished}) {
    SCOPED_TRACE(state);
    QRVDaemonProcess daemon;
    trustInstaller(daemon);
    daemon.start();
    std::vector<QRVPlist> made =
        QRVRepliesAs(daemon, kInstallerUID, {QRVCreateRequest("com.example.r", 2), QRVCreateRequest("com.example.r", 2, /*transient=*/true)});
    for (const QRVPlist& reply : made) ASSERT_EQ(QRVClient::resultCode(reply), 1u);
    const std::string oldPath = made[0].stringForKey("ReplyPath"), newPath = made[1].stringForKey("ReplyPath");
    QRVWriteText(oldPath + "/old.txt", "old");
    QRVWriteText(newPath + "/new.txt", "new");
    daemon.stop();

    const std::string root = daemon.root();
    const std::string staging = root + kUserStaging + "/0F4B8D0A-5D39-4C0E-9A43-1C1B2A3D4E5F";
    const std::string destination = root + kDataClassDirectory + "/" + fs::path(newPath).filename().string();
    if (state >= kOldInStaging) fs::rename(oldPath, staging);
    if (state >= kNewAtDestination) fs::rename(newPath, destination);
    if (state == kFinished) {
      fs::remove_all(staging);
    } else {
      fs::create_directories(root + kReplaceDirectory);
      QRVPlist::Bytes journal = QRVPlist::dictionary()
                                    .set("QRVReplaceOperationOldURL", QRVPlist::string(oldPath))
                                    .set("QRVReplaceOperationNewURL", QRVPlist::string(newPath))
                                    .set("QRVReplaceOperationStagingURL", QRVPlist::string(staging))
                                    .set("QRVReplaceOperationDestURL", QRVPlist::string(destination))
                                    .toBinary();
      std::ofstream(root + kReplaceDirectory + "/interrupted.plist", std::ios::binary)
          .write(reinterpret_cast<const char*>(journal.data()), static_cast<std::streamsize>(journal.size()));
    }

    restartAndExpectCleanedUp(daemon);
    QRVPlist found = QRVRepliesAs(daemon, kInstallerUID, {lookupRequest("com.example.r")})[0];
    ASSERT_EQ(QRVClient::resultCode(found), 1u);
    const std::string live = found.stringForKey("ReplyPath");
    EXPECT_TRUE(fs::exists(live + "/" + kMetadataFile));
    if (state <= kOldInStaging) {
      EXPECT_EQ(live, oldPath);
      EXPECT_TRUE(fs::exists(live + "/old.txt"));
    } else {
      EXPECT_EQ(live, destination);
      EXPECT_TRUE(fs::exists(live + "/new.txt"));
    }
    size_t containers = 0;
    for (const auto& entry : fs::directory_iterator(root + kDataClassDirectory)) {
      EXPECT_TRUE(fs::exists(entry.path() / kMetadataFile)) << entry.path();
      containers++;
    }
    EXPECT_EQ(containers, 1u);
  }
}

namespace {

// One client process of the kill loop: as the installer, creates, replaces,
// wipes and deletes containers of a few identifiers in a random mix until
// the daemon goes away under it, writing a byte to `answered` for each
// request that succeeded. Never returns.
[[noreturn]] void runMixedLoadClient(const std::string& root, unsigned seed, int answered) {
  if (setgid(kInstallerUID) != 0 || setuid(kInstallerUID) != 0) _exit(2);
  std::srand(seed);
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
  while (std::chrono::steady_clock::now() < deadline) {
    QRVClientError error;
    std::optional<QRVClient> client = QRVClient::connect(root, &error);
    if (!client) _exit(0);  // the daemon is gone
    auto send = [&](const QRVPlist& request) -> std::optional<QRVPlist> {
      return client->sendRequest(request, std::chrono::seconds(5), &error);
    };
    const std::string identifier = "com.example.load" + std::to_string(std::rand() % 3);
    auto identity = [&](uint64_t command) {
      return QRVRequest(command)
          .set("Identifier", QRVPlist::string(identifier))
          .set("ContainerClass", QRVPlist::uinteger(2));
    };
    std::optional<QRVPlist> reply;
    switch (std::rand() % 4) {
      case 0:
        reply = send(QRVCreateRequest(identifier, 2));
        break;
      case 1: {
        std::optional<QRVPlist> old = send(QRVCreateRequest(identifier, 2));
        std::optional<QRVPlist> fresh = old ? send(QRVCreateRequest(identifier, 2, /*transient=*/true)) : std::nullopt;
        if (!fresh) _exit(0);
        if (!old->get("ReplyUUID") || !fresh->get("ReplyUUID")) continue;  // raced with a delete
        reply = send(QRVRequest(2)
                         .set("OldIdentifier", QRVPlist::string(identifier))
                         .set("OldContainerClass", QRVPlist::uinteger(2))
                         .set("OldContainerUUID", QRVPlist::data(old->dataForKey("ReplyUUID")))
                         .set("NewIdentifier", QRVPlist::string(identifier))
                         .set("NewContainerClass", QRVPlist::uinteger(2))
                         .set("NewContainerUUID", QRVPlist::data(fresh->dataForKey("ReplyUUID"))));
        break;
      }
      case 2:
        reply = send(identity(12));
        break;
      default:
        reply = send(identity(10));
        break;
    }
    if (!reply) _exit(0);
    if (QRVClient::resultCode(*reply) == 1 && write(answered, "+", 1) != 1) _exit(3);
  }
  _exit(0);
}

// What a start must leave whatever moment the previous daemon died at: no
// journal, staging and death row emptied by the cleanup, and each live
// container whole (its metadata readable and naming its own directory's
// UUID), one at most per identifier.
void expectConsistentAfterRestart(const QRVDaemonProcess& daemon) {
  const std::string root = daemon.root();
  EXPECT_TRUE(isEmptyOrAbsent(root + kReplaceDirectory)) << "a replace journal survived the recovery";
  EXPECT_TRUE(QRVEventually(
      [&] {
        return isEmptyOrAbsent(root + kUserStaging) && isEmptyOrAbsent(root + kCaches + "/Staging") &&
               isEmptyOrAbsent(root + kCaches + "/Dead");
      },
      std::chrono::seconds(10)))
      << "staging or death row still holds something";
  std::map<std::string, std::string> liveByIdentifier;
  if (!fs::exists(root + kDataClassDirectory)) return;
  for (const auto& entry : fs::directory_iterator(root + kDataClassDirectory)) {
    const std::string path = entry.path().string();
    std::ifstream in(path + "/" + kMetadataFile, std::ios::binary);
    const std::string bytes((std::istreambuf_iterator<char>(in)), {});
    std::optional<QRVPlist> metadata =
        QRVPlist::fromBytes(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size());
    ASSERT_TRUE(metadata && metadata->isDictionary()) << "unreadable metadata in " << path;
    EXPECT_EQ(metadata->stringForKey("QRVMetadataUUID"), entry.path().filename().string()) << path;
    const std::string identifier = metadata->stringForKey("QRVMetadataIdentifier");
    auto [it, first] = liveByIdentifier.emplace(identifier, path);
    EXPECT_TRUE(first) << identifier << " is live twice: " << it->second << " and " << path;
  }
}

}  // namespace

// Several clients create, replace, wipe and delete containers while the
// daemon is killed at random moments and restarted. Every start must recover
// to a consistent state. A handful of rounds by default; QUORVAD_KILL_ROUNDS
// asks for more.
TEST(CrashIntegrationTest, KillsUnderMixedLoadAlwaysRestartConsistent) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root: clients run under other uids";
  int rounds = 4;
  if (const char* asked = std::getenv("QUORVAD_KILL_ROUNDS")) rounds = std::max(1, std::atoi(asked));
  constexpr int kClients = 3;
  QRVDaemonProcess daemon;
  trustInstaller(daemon);
  std::mt19937 random(std::random_device{}());
  // The clients count their successes here, so that a loop whose load never
  // got through cannot pass.
  int answered[2];
  ASSERT_EQ(pipe2(answered, O_NONBLOCK), 0);
  size_t succeeded = 0;
  for (int round = 0; round < rounds; round++) {
    SCOPED_TRACE("round " + std::to_string(round));
    daemon.start();
    expectConsistentAfterRestart(daemon);
    if (HasFatalFailure()) return;

    std::vector<pid_t> clients;
    for (int i = 0; i < kClients; i++) {
      pid_t pid = fork();
      ASSERT_GE(pid, 0);
      if (pid == 0) runMixedLoadClient(daemon.root(), static_cast<unsigned>(random()), answered[1]);
      clients.push_back(pid);
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(50 + random() % 400));
    ASSERT_EQ(kill(daemon.pid(), SIGKILL), 0);
    ASSERT_TRUE(daemon.waitForExit(std::chrono::seconds(5)).has_value());
    for (pid_t pid : clients) {
      int status = 0;
      ASSERT_EQ(waitpid(pid, &status, 0), pid);
      EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "client " << pid << " status " << status;
    }
    char bytes[4096];
    for (ssize_t n; (n = read(answered[0], bytes, sizeof bytes)) > 0;) succeeded += static_cast<size_t>(n);
  }
  close(answered[0]);
  close(answered[1]);
  daemon.start();
  expectConsistentAfterRestart(daemon);
  EXPECT_GT(succeeded, static_cast<size_t>(rounds)) << "the clients' requests hardly ever got through";
  std::printf("kill loop: %d rounds, %zu requests succeeded\n", rounds, succeeded);
}

// The data migrator stopped dead after the system-container ACLs, then after
// the bundle ownership: neither step is recorded before it has finished, so
// the next request runs it again, and the one after that finds both done.
TEST(CrashIntegrationTest, ADataMigrationKilledAfterAnyStepIsFinishedByTheNextRequest) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root: clients run under other uids";
  QRVDaemonProcess daemon;
  trustInstaller(daemon);
  daemon.start();
  std::vector<QRVPlist> made =
      QRVRepliesAs(daemon, kInstallerUID,
                   {QRVCreateRequest("com.example.sys", 12), QRVCreateRequest("com.example.app", 1)});
  for (const QRVPlist& reply : made) ASSERT_EQ(QRVClient::resultCode(reply), 1u) << reply.description();
  const std::string binary = made[1].stringForKey("ReplyPath") + "/App.app/binary";
  fs::create_directories(fs::path(binary).parent_path());
  QRVWriteText(binary, "app");
  daemon.stop();
  // A device that had no system containers at its last upgrade recorded the
  // ACLs as done; this one has them now and has not.
  const std::string status = daemon.root() + "/private/var/root/Library/Quorva/qrv_migration_status.plist";
  fs::remove(status);
  auto recorded = [&](const char* type) {
    const std::string bytes = fs::exists(status) ? QRVReadText(status) : std::string();
    std::optional<QRVPlist> plist = QRVPlist::fromBinary(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size());
    return plist && plist->get(type) != nullptr;
  };

  QRVStartArmed(daemon, "migration.acl-standardized");
  QRVExpectStoppedDeadBy(daemon, kInstallerUID, QRVRequest(24));
  EXPECT_FALSE(recorded("ACLMigration"));
  QRVStartArmed(daemon, "migration.bundle-owned");
  QRVExpectStoppedDeadBy(daemon, kInstallerUID, QRVRequest(24));
  EXPECT_TRUE(recorded("ACLMigration"));
  EXPECT_FALSE(recorded("BundleMigration"));

  daemon.start();
  EXPECT_EQ(QRVClient::resultCode(QRVRepliesAs(daemon, kInstallerUID, {QRVRequest(24)})[0]), 1u);
  EXPECT_TRUE(recorded("BundleMigration"));
  struct stat st {};
  ASSERT_EQ(lstat(binary.c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, 33u);
  EXPECT_EQ(QRVReadText(binary), "app");
}

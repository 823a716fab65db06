// What the first start after an upgrade costs the daemon, against the raw
// cost of the same directory work.
//
// The root holds 10,000 data containers in two users (a personal and an
// enterprise persona, 5,000 each: 2,500 application data containers of
// class 2 whose applications are installed, with protection class 3
// recorded, and 2,500 plug-in data containers of class 4 with no class) and
// 200 system containers (195 of class 12, 5 of class 13). Measured, in the
// same run and in alternating rounds:
//  - daemon: the reboot set-up on a new build (every system container's
//    directory renamed to a new UUID, its metadata rewritten and its cache
//    entry replaced; the build-upgrade migration; the build recorded), then
//    command 30's work: the subdirectory migration over every user's
//    per-user containers, then the protection-class step over classes 2
//    and 4 (a bundle look-up per data container, which finds the installed
//    application's, or the intended class, which is the one recorded).
//  - raw: one fd-relative walk over the same class directories: for each
//    data container directory, mkdirat of each default subdirectory (EEXIST
//    ignored) with the owner, mode and class the daemon gives it, and for
//    each system container a rename to a new UUID name in its class
//    directory. Nothing else: no metadata read or written, no locks, no
//    cache. This is the floor of any implementation of the same work.
// Before each round of either side the same state is made again, untimed:
// every data container's default subdirectories are removed (so that each
// round recreates all 60,000), the new build is set in the system info and
// the user migration status file is removed (both only matter to the
// daemon). The raw side renames the system containers back afterwards,
// untimed, so that the daemon's cache still names them. The removal pass
// also checks what the round before made: every subdirectory, with its
// owner and class.
//
// Each figure is the median of $QRV_BENCH_REPETITIONS (default 7) rounds,
// after one untimed round of each, printed with the ratio of the medians.
// Run as root (owners and the trusted class attribute). With TMPDIR on
// /dev/shm it measures the system calls and the CPU; on a disk, the disk's
// metadata path sets the time and the rounds spread widely.
#include <dirent.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <string>
#include <vector>

#include "QRVBenchTiming.h"
#include "base/QRVLog.h"
#include "base/QRVUUID.h"
#include "fs/QRVDictionaryAdditions.h"
#include "migration/QRVContainerMigrator.h"
#include "migration/QRVMigrationStatus.h"
#include "model/QRVPerUserConfiguration.h"
#include "operations/QRVClientConnection.h"
#include "operations/QRVContainerOperationSeams.h"
#include "platform/linux/QRVLinuxFileSystemExtras.h"
#include "support/QRVTestServices.h"

namespace fs = std::filesystem;
using Clock = QRVBench::Clock;
using QRVBench::median;
using QRVBench::millisSince;

namespace {

constexpr int kApplicationsPerUser = 2'500;
constexpr int kPluginsPerUser = 2'500;
constexpr int kSystemContainers = 195;
constexpr int kSystemGroupContainers = 5;
constexpr uint32_t kApplicationProtectionClass = 3;
constexpr const char* kAttribute = QRVLinuxFileSystemExtras::kProtectionClassAttribute;

[[noreturn]] void die(const std::string& what) {
  fprintf(stderr, "%s\n", what.c_str());
  exit(1);
}

bool isDots(const char* name) { return name[0] == '.' && (name[1] == 0 || (name[1] == '.' && name[2] == 0)); }

// The daemon's default subdirectories of a class, in its order (parents
// first), and the class each gets: none for the names kept out of the
// user's data.
struct Subdirectory {
  std::string name;
  uint32_t protectionClass;  // 0: none set
};

// One class directory of data containers, all of one owner and recorded
// protection class.
struct DataClassDirectory {
  std::string path;
  uid_t owner;
  std::vector<Subdirectory> subdirectories;
};

// Every container directory directly in `classDirectory`, opened.
template <typename Body>
void forEachContainer(const std::string& classDirectory, Body body) {
  int dirfd = open(classDirectory.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (dirfd < 0) die("cannot open " + classDirectory);
  DIR* dir = fdopendir(dirfd);
  if (!dir) die("cannot list " + classDirectory);
  while (dirent* entry = readdir(dir)) {
    if (isDots(entry->d_name) || entry->d_type != DT_DIR) continue;
    int container = openat(dirfd, entry->d_name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (container < 0) die(std::string("cannot open container ") + entry->d_name);
    body(container);
    close(container);
  }
  closedir(dir);
}

uint32_t classOf(int fd) {
  uint8_t bytes[4] = {};
  return fgetxattr(fd, kAttribute, bytes, sizeof bytes) == 4 ? uint32_t{bytes[0]} | uint32_t{bytes[1]} << 8 : 0;
}

// The raw floor of the subdirectory work on one container.
void makeSubdirectories(int container, const DataClassDirectory& classDirectory, bool umaskNarrows) {
  for (const Subdirectory& sub : classDirectory.subdirectories) {
    const char* name = sub.name.c_str();
    const bool created = mkdirat(container, name, 0755) == 0;
    if (!created && errno != EEXIST) die("mkdirat " + sub.name + " failed");
    int fd = openat(container, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (fd < 0) die("cannot open " + sub.name);
    if (created && umaskNarrows && fchmod(fd, 0755) != 0) die("fchmod failed");
    if (sub.protectionClass != 0) {
      const uint8_t bytes[4] = {static_cast<uint8_t>(sub.protectionClass), 0, 0, 0};
      if (fsetxattr(fd, kAttribute, bytes, sizeof bytes, 0) != 0) die("fsetxattr failed");
    }
    if (fchown(fd, classDirectory.owner, classDirectory.owner) != 0) die("fchown failed");
    close(fd);
  }
}

struct Rename {
  int dirfd;
  std::string from, to;
};

// The raw floor of the UUID roll of one class directory: every container
// named by a UUID gets a new one. The renames are returned so that they can
// be undone.
void renameSystemContainers(int dirfd, std::vector<Rename>* renames) {
  // Listed first: a directory renamed while it is being read may be seen
  // again under its new name.
  std::vector<std::string> names;
  DIR* dir = fdopendir(dup(dirfd));
  if (!dir) die("cannot list a system class directory");
  while (dirent* entry = readdir(dir))
    if (entry->d_type == DT_DIR && QRVUUID::fromString(entry->d_name)) names.emplace_back(entry->d_name);
  closedir(dir);
  for (const std::string& name : names) {
    std::string fresh = QRVUUID::random().string();
    if (renameat(dirfd, name.c_str(), dirfd, fresh.c_str()) != 0) die("renameat failed");
    renames->push_back({dirfd, name, std::move(fresh)});
  }
}

double timeRaw(const std::vector<DataClassDirectory>& dataDirectories, const std::vector<std::string>& systemDirectories,
               bool umaskNarrows) {
  std::vector<int> systemFDs;
  for (const std::string& path : systemDirectories) {
    int fd = open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (fd < 0) die("cannot open " + path);
    systemFDs.push_back(fd);
  }
  std::vector<Rename> renames;
  auto start = Clock::now();
  for (int fd : systemFDs) renameSystemContainers(fd, &renames);
  for (const DataClassDirectory& classDirectory : dataDirectories)
    forEachContainer(classDirectory.path,
                     [&](int container) { makeSubdirectories(container, classDirectory, umaskNarrows); });
  const double ms = millisSince(start);
  if (renames.size() != kSystemContainers + kSystemGroupContainers)
    die("the raw walk renamed " + std::to_string(renames.size()) + " system containers");
  // The daemon's cache names the old directories.
  for (const Rename& r : renames)
    if (renameat(r.dirfd, r.to.c_str(), r.dirfd, r.from.c_str()) != 0)
      die("renaming " + r.to + " back to " + r.from + " failed: " + strerror(errno));
  for (int fd : systemFDs) close(fd);
  return ms;
}

// Removes every data container's default subdirectories. Unless `first`,
// checks that the round before made each of them, with its owner and class;
// dies when one is missing or wrong.
void removeSubdirectories(const std::vector<DataClassDirectory>& dataDirectories, bool first, const char* side) {
  size_t containers = 0;
  for (const DataClassDirectory& classDirectory : dataDirectories) {
    forEachContainer(classDirectory.path, [&](int container) {
      containers++;
      // Deepest first, so that each removal finds its directory empty.
      for (auto sub = classDirectory.subdirectories.rbegin(); sub != classDirectory.subdirectories.rend(); ++sub) {
        const char* name = sub->name.c_str();
        if (!first) {
          int fd = openat(container, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
          struct stat st{};
          if (fd < 0 || fstat(fd, &st) != 0)
            die(std::string(side) + " did not make " + sub->name + " in a container of " + classDirectory.path);
          if (st.st_uid != classDirectory.owner || (st.st_mode & 07777) != 0755 ||
              classOf(fd) != sub->protectionClass)
            die(std::string(side) + " made " + sub->name + " with another owner, mode or class");
          close(fd);
        }
        if (unlinkat(container, name, AT_REMOVEDIR) != 0 && !(first && errno == ENOENT))
          die("cannot remove " + sub->name);
      }
    });
  }
  if (containers != 2 * (kApplicationsPerUser + kPluginsPerUser))
    die("found " + std::to_string(containers) + " data containers");
}

std::vector<std::string> systemContainerNames(const std::vector<std::string>& systemDirectories) {
  std::vector<std::string> names;
  for (const std::string& directory : systemDirectories)
    for (const auto& entry : fs::directory_iterator(directory)) names.push_back(entry.path().string());
  std::sort(names.begin(), names.end());
  return names;
}

}  // namespace

int main() {
  const int repetitions = QRVBench::repetitions(7);
  QRVLog::setLevel(QRVLogLevel::kError);
  if (geteuid() != 0) die("run as root: owners and the trusted class attribute");

  QRVTestServices env;
  QRVServices& services = *env.services;
  QRVGlobalConfiguration& config = *services.globalConfiguration;
  // Two users: the personal persona and an enterprise one.
  env.personas->supported = true;
  env.personas->list = {{1000, 501, 501, QRVPersonaTypePersonal, "PERSONAL", "/private/var/mobile", {}, true, false},
                        {1001, 501, 501, QRVPersonaTypeEnterprise, "WORK", "/private/var/work", {}, true, false}};
  fs::create_directories(env.root.path() + "/private/var/work");
  services.userIdentityCache->flush();
  const QRVUserIdentityRef users[] = {services.userIdentityCache->userIdentityForPersonalPersona(),
                                      services.userIdentityCache->userIdentityWithPersonaID(1001)};
  if (!users[0] || !users[1]) die("the personas did not give two users");
  const QRVUserIdentityRef system = services.userIdentityCache->defaultUserIdentity();

  auto connection = QRVClientConnection::makeSharedClientConnection(env.services);
  auto create = [&](const QRVUserIdentityRef& user, const std::string& identifier, QRVContainerClass containerClass) {
    QRVError error;
    auto identity = QRVContainerIdentity::containerIdentityWithUserIdentity(user, identifier, containerClass, &error);
    QRVMetadataRef made = identity ? connection->createOrLookupContainerWithContainerIdentity(
                                         identity, /*createIfNecessary=*/true, false, true, &error)
                                   : nullptr;
    if (!made) die("creating " + identifier + " failed: " + error.description());
    return made;
  };
  auto setUpStart = Clock::now();
  // The applications are installed: their bundle containers exist, so the
  // protection-class step leaves their data containers' class alone.
  for (int i = 0; i < kApplicationsPerUser; i++)
    create(system, "com.example.bench.app" + std::to_string(i), QRVContainerClassAppBundle);
  for (const QRVUserIdentityRef& user : users) {
    for (int i = 0; i < kApplicationsPerUser; i++) {
      QRVMetadataRef data = create(user, "com.example.bench.app" + std::to_string(i), QRVContainerClassAppData);
      QRVError error;
      if (!connection->setInfoValue(QRVPlist::uinteger(kApplicationProtectionClass),
                                    QRVPlist::string(kQRVContentProtectionClassKey), data->containerIdentity(),
                                    /*useLocking=*/true, &error))
        die("recording the class failed: " + error.description());
    }
    for (int i = 0; i < kPluginsPerUser; i++)
      create(user, "com.example.bench.plugin" + std::to_string(i), QRVContainerClassPluginData);
  }
  for (int i = 0; i < kSystemContainers; i++)
    create(system, "com.example.bench.service" + std::to_string(i), QRVContainerClassSystemData);
  for (int i = 0; i < kSystemGroupContainers; i++)
    create(system, "systemgroup.com.example.bench" + std::to_string(i), QRVContainerClassSystemGroup);

  // What the raw side walks, from the daemon's own tables.
  std::vector<DataClassDirectory> dataDirectories;
  for (const QRVUserIdentityRef& user : users) {
    for (QRVContainerClass c : {QRVContainerClassAppData, QRVContainerClassPluginData}) {
      const uint32_t recorded = c == QRVContainerClassAppData ? kApplicationProtectionClass : 0;
      DataClassDirectory directory{*config.containerDirectoryURLForUserIdentity(user, c, false),
                                   user->posixUIDForContainerClass(c),
                                   {}};
      const auto& excluded = QRVGlobalConfiguration::excludedFromAppUserData();
      for (const std::string& name : services.platform.fileSystem->defaultSubdirectories(c))
        directory.subdirectories.push_back(
            {name, std::find(excluded.begin(), excluded.end(), name) != excluded.end() ? 0 : recorded});
      dataDirectories.push_back(std::move(directory));
    }
  }
  const std::vector<std::string> systemDirectories = {
      *config.containerDirectoryURLForUserIdentity(system, QRVContainerClassSystemData, false),
      *config.containerDirectoryURLForUserIdentity(system, QRVContainerClassSystemGroup, false)};
  if (systemContainerNames(systemDirectories).size() != kSystemContainers + kSystemGroupContainers)
    die("the system class directories hold something else too");
  const mode_t mask = umask(0);
  umask(mask);
  const bool umaskNarrows = (mask & 0755) != 0;

  const std::string userStatusFile =
      QRVPathByAppendingComponent(config.getPerUserConfigurationForUserIdentity(system)->libraryDirectory(),
                                  "qrv_user_migration_status.plist");
  // The build recorded now is the one every round upgrades from.
  {
    auto status = QRVMigrationStatus::initForSystemMigration(services);
    if (!status || !status->writeCurrentBuildInfoToDisk()) die("recording the first build failed");
  }
  printf("set-up: %d data containers in 2 users, %d system containers, %.0f ms under %s\n",
         2 * (kApplicationsPerUser + kPluginsPerUser), kSystemContainers + kSystemGroupContainers,
         millisSince(setUpStart), env.root.path().c_str());

  struct {
    std::vector<double> boot, command30, protection;
  } phases;
  int builds = 0;
  bool first = true;
  auto daemonRound = [&] {
    removeSubdirectories(dataDirectories, first, "the raw walk");
    first = false;
    env.systemInfo->build = "2B" + std::to_string(++builds);
    std::error_code ignored;
    fs::remove(userStatusFile, ignored);
    const std::vector<std::string> before = systemContainerNames(systemDirectories);

    auto start = Clock::now();
    connection->rebootQuorvaSetup();
    const double bootMs = millisSince(start);
    QRVError error;
    if (!services.containerMigrator->performPerUserDataMigrationForClientConnection(*connection, &error))
      die("the per-user migration failed: " + error.description());
    const double ms = millisSince(start);
    phases.boot.push_back(bootMs);
    phases.command30.push_back(ms - bootMs);
    // Once more, untimed in the figure: with the subdirectories recorded it
    // runs only the protection-class step, whose share this tells.
    auto protectionStart = Clock::now();
    if (!services.containerMigrator->performPerUserDataMigrationForClientConnection(*connection, &error))
      die("the per-user migration failed: " + error.description());
    phases.protection.push_back(millisSince(protectionStart));

    const std::vector<std::string> after = systemContainerNames(systemDirectories);
    std::vector<std::string> kept;
    std::set_intersection(before.begin(), before.end(), after.begin(), after.end(), std::back_inserter(kept));
    if (after.size() != before.size() || !kept.empty())
      die(std::to_string(kept.size()) + " system containers kept their directory");
    if (!fs::exists(userStatusFile)) die("the user migration status is not at " + userStatusFile);
    auto userStatus = QRVMigrationStatus::initForMobileUserMigration(services);
    if (!userStatus || !userStatus->hasMigrationOccurredForType(QRVMigrationStatus::kSubdirectoryMigration))
      die("the subdirectory migration was not recorded");
    return ms;
  };
  auto rawRound = [&] {
    removeSubdirectories(dataDirectories, first, "the daemon");
    first = false;
    return timeRaw(dataDirectories, systemDirectories, umaskNarrows);
  };
  // Which side checks whom: each removal checks the round just before it,
  // so the rounds alternate strictly, raw first.
  rawRound();
  daemonRound();
  std::vector<double> raw, daemon;
  for (int r = 0; r < repetitions; r++) {
    raw.push_back(rawRound());
    daemon.push_back(daemonRound());
    printf("round %d: raw %.1f ms, daemon %.1f ms (%.2fx)\n", r + 1, raw.back(), daemon.back(),
           daemon.back() / raw.back());
  }
  // The last daemon round is checked too.
  removeSubdirectories(dataDirectories, false, "the daemon");
  const double rawMedian = median(raw), daemonMedian = median(daemon);
  printf("daemon phases (medians): reboot set-up %.1f ms, command 30 %.1f ms, of which the protection-class step "
         "alone takes %.1f ms\n",
         median(phases.boot), median(phases.command30), median(phases.protection));
  printf("raw walk, subdirectories and renames:   %.1f ms (median of %d)\n", rawMedian, repetitions);
  printf("daemon, reboot set-up and command 30:   %.1f ms (median of %d), %.2fx raw\n", daemonMedian, repetitions,
         daemonMedian / rawMedian);
  return 0;
}

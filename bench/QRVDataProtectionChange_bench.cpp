// What changing a data container's protection class costs, against the raw
// cost of visiting every item of the same tree and setting the same
// attribute.
//
// The container holds 100,000 files in 1,000 directories (half under
// "Documents", half under "Library"). Measured, in the same run and in
// alternating rounds:
//  - raw: one fd-relative walk (openat with O_NOFOLLOW, fdopendir, fstatat
//    of nothing: d_type decides) that reads each directory's and each file's
//    class attribute and sets it to 3 where it differs. Nothing else: no
//    update file, no locks, no look-up. This is the floor of any change that
//    has to touch every item.
//  - change: the data-protection manager lowering the container from 3 to 1,
//    as command 21 does it: the container looked up, the durable update
//    file written, one pass under the container's lock that reads and sets
//    every item's class without following links, the update file removed and
//    the class recorded in the container's info.
// Each round runs raw (1 -> 3) then change (3 -> 1), so both set every item.
// Each figure is the median of $QRV_BENCH_REPETITIONS (default 7) rounds,
// printed with the ratio of the medians.
//
// Run as root (the class attribute is a trusted one), with TMPDIR on a file
// system that keeps trusted attributes: /dev/shm measures CPU and system
// calls rather than the disk.
#include <dirent.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>
#include <string>
#include <vector>

#include "QRVBenchTiming.h"
#include "base/QRVLog.h"
#include "dataprotection/QRVDataProtectionManager.h"
#include "operations/QRVClientConnection.h"
#include "platform/linux/QRVLinuxFileSystem.h"
#include "platform/linux/QRVLinuxFileSystemExtras.h"
#include "platform/linux/QRVLinuxLockStateService.h"
#include "support/QRVTestServices.h"

namespace fs = std::filesystem;
using Clock = QRVBench::Clock;
using QRVBench::median;
using QRVBench::millisSince;

namespace {

constexpr int kDirectories = 1'000;
constexpr int kFilesPerDirectory = 100;
constexpr const char* kAttribute = QRVLinuxFileSystemExtras::kProtectionClassAttribute;

// Reads the class of the open item and sets it to `target` where it
// differs (or, given `mismatches`, only counts it there); counts the items
// seen.
void setClass(int fd, uint32_t target, size_t* items, size_t* mismatches) {
  uint8_t bytes[4] = {};
  ssize_t n = fgetxattr(fd, kAttribute, bytes, sizeof bytes);
  const uint32_t current = n == 4 ? uint32_t{bytes[0]} | uint32_t{bytes[1]} << 8 : 0;
  if (current != target && mismatches) {
    (*mismatches)++;
  } else if (current != target) {
    const uint8_t wanted[4] = {static_cast<uint8_t>(target), 0, 0, 0};
    if (fsetxattr(fd, kAttribute, wanted, sizeof wanted, 0) != 0) {
      perror("fsetxattr");
      abort();
    }
  }
  (*items)++;
}

// The raw walk below the open directory `dirfd`, which it closes.
void rawWalk(int dirfd, uint32_t target, size_t* items, size_t* mismatches) {
  DIR* dir = fdopendir(dirfd);
  if (!dir) abort();
  while (dirent* entry = readdir(dir)) {
    const char* name = entry->d_name;
    if (name[0] == '.' && (name[1] == 0 || (name[1] == '.' && name[2] == 0))) continue;
    if (entry->d_type == DT_DIR) {
      int child = openat(dirfd, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
      if (child < 0) abort();
      rawWalk(child, target, items, mismatches);
    } else if (entry->d_type == DT_REG) {
      int child = openat(dirfd, name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
      if (child < 0) abort();
      setClass(child, target, items, mismatches);
      close(child);
    }
  }
  // Directories after their contents, as the daemon's walk does.
  setClass(dirfd, target, items, mismatches);
  closedir(dir);
}

double timeRaw(const std::string& container, uint32_t target, size_t expected, size_t* mismatches = nullptr) {
  auto start = Clock::now();
  size_t items = 0;
  for (const char* item : {"Documents", "Library", "tmp"}) {
    int fd = open((container + "/" + item).c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (fd < 0) abort();
    rawWalk(fd, target, &items, mismatches);
  }
  double ms = millisSince(start);
  if (items != expected) {
    fprintf(stderr, "raw walk saw %zu items, expected %zu\n", items, expected);
    abort();
  }
  return ms;
}

}  // namespace

int main() {
  const int repetitions = QRVBench::repetitions(7);
  QRVLog::setLevel(QRVLogLevel::kError);
  if (geteuid() != 0) {
    fprintf(stderr, "run as root: the class attribute is a trusted extended attribute\n");
    return 1;
  }

    // The daemon's own file-system pieces (and the lock state from its file,
  // which every class change checks), the test fakes for the rest.
  QRVTestServices env;
  QRVPlatform platform = env.services->platform;
  const std::string lockStateFile = env.root.path() + "/run/quorva/lockstate";
  fs::create_directories(fs::path(lockStateFile).parent_path());
  std::ofstream(lockStateFile) << "0\n";
  platform.lockState = std::make_shared<QRVLinuxLockStateService>(lockStateFile);
  // Watched, as the daemon watches it from its start.
  if (platform.lockState->observe([] {}) != 0) {
    fprintf(stderr, "watching the lock-state file failed\n");
    return 1;
  }
  platform.posixFileSystem = std::make_shared<QRVLinuxFileSystem>();
  platform.fileSystem = std::make_shared<QRVLinuxFileSystemExtras>(platform.lockState);
  std::shared_ptr<QRVServices> shared = QRVServices::make(env.root.path(), platform);
  QRVServices& services = *shared;
  auto connection = QRVClientConnection::makeSharedClientConnection(shared);
  QRVError error;
  QRVUserIdentityRef user = services.userIdentityCache->userIdentityForPersonalPersonaWithUID(501, 501);
  auto identity = QRVContainerIdentity::containerIdentityWithUserIdentity(user, "com.example.bench.protected",
                                                                          QRVContainerClassAppData, &error);
  QRVMetadataRef container = identity ? connection->createOrLookupContainerWithContainerIdentity(
                                            identity, /*createIfNecessary=*/true, false, true, &error)
                                      : nullptr;
  if (!container) {
    fprintf(stderr, "creating the container failed: %s\n", error.description().c_str());
    return 1;
  }
  const std::string root = container->url();
  auto setUpStart = Clock::now();
  for (int d = 0; d < kDirectories; d++) {
    const std::string dir = root + (d % 2 ? "/Documents/d" : "/Library/d") + std::to_string(d);
    fs::create_directories(dir);
    for (int f = 0; f < kFilesPerDirectory; f++) std::ofstream(dir + "/f" + std::to_string(f)) << f;
  }
  size_t expected = 0;
  for (const char* item : {"Documents", "Library", "tmp"})
    expected += 1 + std::distance(fs::recursive_directory_iterator(root + "/" + item), {});
  {
    const uint8_t probe[4] = {1, 0, 0, 0};
    if (setxattr((root + "/Documents").c_str(), kAttribute, probe, sizeof probe, 0) != 0) {
      perror("the file system under TMPDIR keeps no trusted attributes");
      return 1;
    }
  }
  printf("set-up: %zu items (%d files) in %.0f ms under %s\n", expected, kDirectories * kFilesPerDirectory,
         millisSince(setUpStart), root.c_str());

  QRVDataProtectionManager& manager = *services.dataProtectionManager;
  auto recordClass = [&](uint32_t c) {
    QRVError e;
    if (!connection->setInfoValue(QRVPlist::uinteger(c), QRVPlist::string(kQRVContentProtectionClassKey),
                                  container->containerIdentity(), true, &e)) {
      fprintf(stderr, "recording the class failed: %s\n", e.description().c_str());
      exit(1);
    }
  };
  auto timeChange = [&](int32_t target) {
    std::promise<uint64_t> done;
    auto start = Clock::now();
    manager.setDataProtectionOnDataContainerForContainerIdentity(
        container->containerIdentity(), target, /*isSecondOrThirdPartyApp=*/false, /*retryIfLocked=*/false,
        [&](const QRVError* e) { done.set_value(e ? e->code() : 1); });
    uint64_t code = done.get_future().get();
    double ms = millisSince(start);
    if (code != 1) {
      fprintf(stderr, "the change failed: %llu\n", static_cast<unsigned long long>(code));
      exit(1);
    }
    return ms;
  };

  std::vector<double> raw, change;
  for (int r = 0; r < repetitions; r++) {
    raw.push_back(timeRaw(root, 3, expected));
    recordClass(3);
    change.push_back(timeChange(1));
    // The change must have reached every item, or the comparison is void.
    size_t mismatches = 0;
    timeRaw(root, 1, expected, &mismatches);
    if (mismatches != 0) {
      fprintf(stderr, "the change left %zu items in another class\n", mismatches);
      return 1;
    }
    printf("round %d: raw %.1f ms, change %.1f ms (%.2fx)\n", r + 1, raw.back(), change.back(),
           change.back() / raw.back());
  }
  const double rawMedian = median(raw), changeMedian = median(change);
  printf("raw fd-relative walk, read and set: %.1f ms (median of %d)\n", rawMedian, repetitions);
  printf("data-protection change 3 -> 1:      %.1f ms (median of %d), %.2fx raw\n", changeMedian, repetitions,
         changeMedian / rawMedian);
  return 0;
}

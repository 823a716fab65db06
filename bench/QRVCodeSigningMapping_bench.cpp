// What a group change and the boot-time group sweep cost, against the raw
// cost of reading and decoding every row of the code-signing database.
//
// 10,000 installed applications each claim three of 1,000 application
// groups, and every group has a container for the default user. Measured,
// in the same run and interleaved:
//  - raw: one pass of plain SQLite over a copy of the same database (built
//    from the same entries), selecting every identifier and dictionary and
//    decoding each dictionary; nothing else. This is the floor of anything
//    that has to look at every row.
//  - process: the installer hands over new information for one application
//    that drops one of its groups and takes another (the dropped group is
//    still claimed by others, so nothing is deleted). The drop makes the
//    mapping count every claim in the database before it writes.
//  - sweep: the boot-time sweep of application-group containers, which
//    counts every claim and lists the containers of every user.
// Process and sweep run twice: with the counts the mapping keeps beside the
// database, and with the counts dropped first, so that they are walked from
// every row as before the counts were kept. Each figure is the median of
// $QRV_BENCH_REPETITIONS (default 7) rounds, each printed with its ratio to
// the raw read.
//
// Set TMPDIR to a tmpfs (e.g. /dev/shm) to measure CPU rather than fsync.
#include <sqlite3.h>
#include <stdio.h>
#include <stdlib.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <string>
#include <vector>

#include "QRVBenchTiming.h"
#include "codesigning/QRVCodeSigningMapping.h"
#include "codesigning/QRVGroupManager.h"
#include "codesigning/QRVSQLiteDB.h"
#include "core/QRVCommandQueue.h"
#include "operations/QRVClientConnection.h"
#include "support/QRVTestServices.h"

namespace fs = std::filesystem;
using Clock = QRVBench::Clock;
using QRVBench::median;
using QRVBench::millisSince;

namespace {

constexpr int kApplications = 10'000;
constexpr int kGroups = 1'000;

std::string application(int i) { return "com.example.bench.app" + std::to_string(i); }
std::string group(int g) { return "group.com.example.bench.shared" + std::to_string(g % kGroups); }

// The code-signing dictionary of application `i`, claiming groups
// i, i+1 and i+2 (mod 1,000), or i+3 in place of i+2 when `changed`.
QRVPlist codeSigningInfo(int i, bool changed) {
  QRVPlist groups = QRVPlist::array();
  groups.append(QRVPlist::string(group(i)));
  groups.append(QRVPlist::string(group(i + 1)));
  groups.append(QRVPlist::string(group(changed ? i + 3 : i + 2)));
  QRVPlist entitlements = QRVPlist::dictionary();
  entitlements.set(kQRVApplicationGroupsEntitlement, std::move(groups));
  entitlements.set("com.kelva.private.bench.padding", QRVPlist::string(std::string(200, 'x')));
  return QRVPlist::dictionary().set(kQRVCodeSigningEntitlementsKey, std::move(entitlements));
}

QRVPlist options() { return QRVPlist::dictionary().set(kQRVDataContainerClassOption, QRVPlist::uinteger(2)); }

// The floor: every row read and its dictionary decoded, with plain SQLite.
double rawFullRead(const fs::path& file) {
  auto start = Clock::now();
  sqlite3* db = nullptr;
  if (sqlite3_open_v2(file.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) abort();
  sqlite3_stmt* s = nullptr;
  if (sqlite3_prepare_v2(db,
                         "SELECT code_signing_info.code_signing_id_text, code_signing_data.data FROM "
                         "code_signing_info JOIN code_signing_data ON code_signing_data.cs_info_id = "
                         "code_signing_info.id;",
                         -1, &s, nullptr) != SQLITE_OK)
    abort();
  size_t decoded = 0;
  while (sqlite3_step(s) == SQLITE_ROW) {
    std::string identifier(reinterpret_cast<const char*>(sqlite3_column_text(s, 0)), sqlite3_column_bytes(s, 0));
    auto plist = QRVPlist::fromBytes(static_cast<const uint8_t*>(sqlite3_column_blob(s, 1)),
                                     static_cast<size_t>(sqlite3_column_bytes(s, 1)));
    if (plist && !identifier.empty()) decoded++;
  }
  sqlite3_finalize(s);
  sqlite3_close(db);
  if (decoded != kApplications) {
    fprintf(stderr, "raw read decoded %zu rows, expected %d\n", decoded, kApplications);
    abort();
  }
  return millisSince(start);
}

}  // namespace

int main() {
  const int repetitions = QRVBench::repetitions(7);
  QRVLog::setLevel(QRVLogLevel::kError);

  QRVTestServices env;
  QRVServices& services = *env.services;
  QRVCodeSigningMapping& mapping = *services.codeSigningMapping;

  // The installed applications, through the mapping as the installer does it.
  auto setUpStart = Clock::now();
  for (int i = 0; i < kApplications; i++) {
    QRVCommandQueue queue;
    uint64_t code = mapping.processCodeSigningInfo(codeSigningInfo(i, false), application(i), options(), queue);
    if (code != 1) {
      fprintf(stderr, "processing %s failed: %llu\n", application(i).c_str(), static_cast<unsigned long long>(code));
      return 1;
    }
  }
  // A container per group for the default user, as the applications' first
  // look-ups would have made them.
  auto connection = QRVClientConnection::makeSharedClientConnection(env.services);
  QRVUserIdentityRef user = services.userIdentityCache->defaultUserIdentity();
  for (int g = 0; g < kGroups; g++) {
    QRVError error;
    auto identity =
        QRVContainerIdentity::containerIdentityWithUserIdentity(user, group(g), QRVContainerClassAppGroup, &error);
    if (!identity || !connection->createOrLookupContainerWithContainerIdentity(identity, true, false, true, &error)) {
      fprintf(stderr, "creating group container %d failed: %s\n", g, error.description().c_str());
      return 1;
    }
  }
  // The raw side reads its own database of the same entries: the mapping
  // holds its file exclusively.
  QRVTemporaryDirectory rawDirectory;
  {
    auto rawDB = QRVSQLiteDB::initWithParentDirectoryURL(rawDirectory.path());
    for (int i = 0; i < kApplications; i++) {
      QRVCodeSigningEntry entry(codeSigningInfo(i, false), 2);
      QRVError error;
      if (!rawDB->addCodeSigningEntry(&entry, application(i), &error)) abort();
    }
  }
  const fs::path rawFile = fs::path(rawDirectory.path()) / "containers.sqlite3";
  printf("set-up: %d applications, %d groups, %.0f ms\n", kApplications, kGroups, millisSince(setUpStart));

  // The mapping keeps its counts beside the database; the "walked" variants
  // drop them first, so they pay the full walk of every row as a mapping
  // without kept counts would.
  bool changed = false;
  auto timeProcess = [&](bool walked) {
    if (walked) mapping.TEST_forgetReferenceCounts();
    changed = !changed;
    QRVCommandQueue queue;
    auto start = Clock::now();
    uint64_t code = mapping.processCodeSigningInfo(codeSigningInfo(7, changed), application(7), options(), queue);
    double ms = millisSince(start);
    if (code != 1 || queue.pendingCount() != 0) {
      fprintf(stderr, "processing a change failed: %llu, %zu queued\n", static_cast<unsigned long long>(code),
              queue.pendingCount());
      exit(1);
    }
    return ms;
  };
  auto timeSweep = [&](bool walked) {
    if (walked) mapping.TEST_forgetReferenceCounts();
    QRVCommandQueue queue;
    auto start = Clock::now();
    services.groupManager->reconcileGroupContainersOfType(QRVGroupTypeApplication, queue);
    double ms = millisSince(start);
    if (queue.pendingCount() != 0) {
      fprintf(stderr, "the sweep wanted to delete %zu claimed groups\n", queue.pendingCount());
      exit(1);
    }
    return ms;
  };
  // Warm the kept counts once, as the first change after start does.
  timeProcess(false);

  enum { kRaw, kProcess, kProcessWalked, kSweep, kSweepWalked, kVariants };
  const char* names[kVariants] = {"raw full read", "process one change", "process one change, counts walked",
                                  "boot sweep", "boot sweep, counts walked"};
  std::vector<double> times[kVariants];
  for (int r = 0; r < repetitions; r++) {
    // Rotate the order so that no variant always runs first.
    for (int k = 0; k < kVariants; k++) {
      switch ((r + k) % kVariants) {
        case kRaw:
          times[kRaw].push_back(rawFullRead(rawFile));
          break;
        case kProcess:
          times[kProcess].push_back(timeProcess(false));
          break;
        case kProcessWalked:
          times[kProcessWalked].push_back(timeProcess(true));
          break;
        case kSweep:
          times[kSweep].push_back(timeSweep(false));
          break;
        default:
          times[kSweepWalked].push_back(timeSweep(true));
          break;
      }
    }
  }
  double medians[kVariants];
  printf("medians of %d rounds, ms:\n", repetitions);
  for (int v = 0; v < kVariants; v++) {
    medians[v] = median(times[v]);
    printf("  %-36s %9.3f  (x%.3f of raw)\n", names[v], medians[v], medians[v] / medians[kRaw]);
  }
  return 0;
}

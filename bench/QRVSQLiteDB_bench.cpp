// The code-signing database against raw SQLite doing the same work.
//
// One pass stores 10,000 entries, each with a code-signing dictionary of
// about 2 KB, one transaction per entry: first as inserts into an empty
// database, then as updates of every entry with a new dictionary. The raw
// baseline runs the same statements in the same transactions on a file set
// up by the same schema script, with its statements prepared once and reused
// and its dictionary serialized by the same property-list code. The ratio
// printed at the end (entries per second of the class over the raw rate) is
// therefore the cost of everything the class adds to SQLite.
//
// "RawPreserialized" also leaves out serialization, to show its share.
//
// The database lives under $QRV_BENCH_DIR (default: the temporary directory);
// $QRV_BENCH_REPETITIONS sets the number of passes per variant.
// Every COMMIT syncs the WAL, so on a disk the figures mostly measure fsync;
// a tmpfs directory shows the CPU cost.
#include <benchmark/benchmark.h>
#include <sqlite3.h>
#include <stdlib.h>

#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "QRVBenchTiming.h"
#include "codesigning/QRVSQLiteDB.h"

namespace fs = std::filesystem;

namespace {

constexpr int kEntries = 10'000;
constexpr size_t kDictionaryBytes = 2048;

std::string identifier(int i) { return "com.example.bench.app" + std::to_string(i); }

// About 2 KB once serialized, different for every identifier and version.
QRVPlist dictionary(int i, int version) {
  QRVPlist entitlements;
  QRVPlist groups;
  for (int g = 0; g < 4; g++)
    groups.append(QRVPlist::string(fmt::format("group.com.example.bench.{}.{}", i, g)));
  entitlements.set("com.kelva.security.application-groups", std::move(groups));
  entitlements.set("com.kelva.security.system-container", QRVPlist::boolean(true));
  QRVPlist info;
  for (int k = 0;; k++) {
    info.set("com.kelva.Quorva.Entitlements", entitlements);
    if (info.toBinary().size() >= kDictionaryBytes) break;
    entitlements.set(fmt::format("com.kelva.private.bench.entitlement{:02}", k),
                     QRVPlist::string(fmt::format("value {} of {} in version {}", k, i, version)));
  }
  return info;
}

struct Workload {
  std::vector<std::string> identifiers;
  std::vector<QRVCodeSigningEntry> first, second;
  std::vector<QRVPlist::Bytes> firstBlobs, secondBlobs;
};

const Workload& workload() {
  static const Workload built = [] {
    Workload w;
    for (int i = 0; i < kEntries; i++) {
      w.identifiers.push_back(identifier(i));
      w.first.emplace_back(dictionary(i, 1), 2);
      w.second.emplace_back(dictionary(i, 2), 2);
      w.firstBlobs.push_back(w.first.back().codeSigningInfo().toBinary());
      w.secondBlobs.push_back(w.second.back().codeSigningInfo().toBinary());
    }
    return w;
  }();
  return built;
}

class TempDir {
 public:
  TempDir() {
    const char* base = getenv("QRV_BENCH_DIR");
    std::string pattern = ((base ? fs::path(base) : fs::temp_directory_path()) / "qrvbench.XXXXXX");
    if (!mkdtemp(pattern.data())) abort();
    path_ = pattern;
  }
  ~TempDir() { fs::remove_all(path_); }
  const fs::path& path() const { return path_; }

 private:
  fs::path path_;
};

// The class's statements, run directly on one connection.
class RawDB {
 public:
  explicit RawDB(const fs::path& dir)
      : db_(QRVSQLiteDB::openDBWithURL(dir / "containers.sqlite3")) {
    prepare(&update_,
            "UPDATE code_signing_info SET invalid=?, placeholder=?, registered_by_caller=?, "
            "data_container_class=? WHERE code_signing_id_text=?;");
    prepare(&insert_,
            "INSERT INTO code_signing_info (invalid, placeholder, registered_by_caller, "
            "data_container_class, code_signing_id_text) VALUES (?, ?, ?, ?, ?);");
    prepare(&data_,
            "INSERT OR REPLACE INTO code_signing_data (cs_info_id, data) SELECT id, ? FROM "
            "code_signing_info WHERE code_signing_id_text = ?;");
  }
  ~RawDB() {
    for (sqlite3_stmt* s : {update_, insert_, data_}) sqlite3_finalize(s);
    sqlite3_close(db_);
  }

  void store(const std::string& id, const QRVCodeSigningEntry& entry, const QRVPlist::Bytes* blob) {
    QRVPlist::Bytes serialized;
    if (!blob) {
      serialized = entry.codeSigningInfo().toBinary();
      blob = &serialized;
    }
    exec("BEGIN;");
    if (runInfo(update_, id, entry) != 1) runInfo(insert_, id, entry);
    sqlite3_bind_blob64(data_, 1, blob->data(), blob->size(), SQLITE_STATIC);
    sqlite3_bind_text64(data_, 2, id.data(), id.size(), SQLITE_TRANSIENT, SQLITE_UTF8);
    step(data_);
    exec("COMMIT;");
  }

 private:
  void prepare(sqlite3_stmt** s, const char* sql) {
    if (sqlite3_prepare_v2(db_, sql, -1, s, nullptr) != SQLITE_OK) abort();
  }
  void exec(const char* sql) {
    if (sqlite3_exec(db_, sql, nullptr, nullptr, nullptr) != SQLITE_OK) abort();
  }
  void step(sqlite3_stmt* s) {
    if (sqlite3_step(s) != SQLITE_DONE) abort();
    sqlite3_reset(s);
    sqlite3_clear_bindings(s);
  }
  int runInfo(sqlite3_stmt* s, const std::string& id, const QRVCodeSigningEntry& entry) {
    sqlite3_bind_int(s, 1, entry.isInvalid());
    sqlite3_bind_int(s, 2, (entry.isPlaceholder() ? 1 : 0) | (entry.isAdvanceCopy() ? 2 : 0));
    sqlite3_bind_int(s, 3, entry.isRegisteredByCaller());
    sqlite3_bind_int(s, 4, static_cast<int>(entry.dataContainerClass()));
    sqlite3_bind_text64(s, 5, id.data(), id.size(), SQLITE_TRANSIENT, SQLITE_UTF8);
    step(s);
    return sqlite3_changes(db_);
  }

  sqlite3* db_;
  sqlite3_stmt* update_ = nullptr;
  sqlite3_stmt* insert_ = nullptr;
  sqlite3_stmt* data_ = nullptr;
};

enum class Impl { kClass, kRaw, kRawPreserialized };

// One iteration is one pass over all entries. Creating, seeding, closing and
// removing the database are not timed.
void run(benchmark::State& state, Impl impl, bool updates) {
  const Workload& w = workload();
  for (auto _ : state) {
    state.PauseTiming();
    {
      TempDir dir;
      std::unique_ptr<QRVSQLiteDB> db;
      std::unique_ptr<RawDB> raw;
      if (impl == Impl::kClass)
        db = QRVSQLiteDB::initWithParentDirectoryURL(dir.path());
      else
        raw = std::make_unique<RawDB>(dir.path());
      auto pass = [&](const std::vector<QRVCodeSigningEntry>& entries,
                      const std::vector<QRVPlist::Bytes>& blobs) {
        for (int i = 0; i < kEntries; i++) {
          if (db) {
            QRVError error;
            if (!db->addCodeSigningEntry(&entries[i], w.identifiers[i], &error)) {
              state.SkipWithError(error.description().c_str());
              return;
            }
          } else {
            raw->store(w.identifiers[i], entries[i],
                       impl == Impl::kRawPreserialized ? &blobs[i] : nullptr);
          }
        }
      };
      if (updates) pass(w.first, w.firstBlobs);
      state.ResumeTiming();
      pass(updates ? w.second : w.first, updates ? w.secondBlobs : w.firstBlobs);
      state.PauseTiming();
    }
    state.ResumeTiming();
  }
  state.SetItemsProcessed(state.iterations() * kEntries);
}

// Prints the usual table, then entries per second of each variant (the
// median pass) and the class's rate over the raw one's, all from this run.
// Wall-clock rates include the disk's sync latency, which other load on the
// machine makes noisy; CPU rates do not.
class RatioReporter : public benchmark::ConsoleReporter {
 public:
  void ReportRuns(const std::vector<Run>& runs) override {
    ConsoleReporter::ReportRuns(runs);
    for (const Run& r : runs) {
      const bool median = r.run_type == Run::RT_Aggregate && r.aggregate_name == "median";
      if (r.error_occurred || !(median || r.run_type == Run::RT_Iteration)) continue;
      if (r.real_accumulated_time <= 0 || r.cpu_accumulated_time <= 0) continue;
      const double entries = static_cast<double>(r.iterations) * kEntries;
      rates_[r.run_name.function_name] = {entries / r.real_accumulated_time,
                                          entries / r.cpu_accumulated_time};
    }
  }
  void printRatios() const {
    for (const char* op : {"Insert", "Update"}) {
      auto rate = [&](const char* impl) {
        auto it = rates_.find(std::string(op) + "/" + impl);
        return it == rates_.end() ? Rates{} : it->second;
      };
      const Rates cls = rate("QRVSQLiteDB"), raw = rate("Raw"), pre = rate("RawPreserialized");
      printf(
          "%s, entries/s wall (cpu): QRVSQLiteDB %.0f (%.0f), raw %.0f (%.0f), raw without "
          "serialization %.0f (%.0f)\n"
          "%s ratio QRVSQLiteDB/raw: %.3f wall, %.3f cpu; against raw without serialization: "
          "%.3f wall, %.3f cpu\n",
          op, cls.wall, cls.cpu, raw.wall, raw.cpu, pre.wall, pre.cpu, op,
          ratio(cls.wall, raw.wall), ratio(cls.cpu, raw.cpu), ratio(cls.wall, pre.wall),
          ratio(cls.cpu, pre.cpu));
    }
  }

 private:
  struct Rates {
    double wall = 0, cpu = 0;
  };
  static double ratio(double a, double b) { return b > 0 ? a / b : 0.0; }
  std::map<std::string, Rates> rates_;
};

}  // namespace

// QRV_BENCH_REPETITIONS passes per variant (default 5), run in random
// interleaved order so that a change in the machine's load hits every
// variant alike; the figures are the medians.
int main(int argc, char** argv) {
  const int repetitions = QRVBench::repetitions(5);
  workload();  // built once, before anything is timed
  for (const char* op : {"Insert", "Update"}) {
    const bool updates = std::string(op) == "Update";
    for (auto [name, impl] : {std::pair{"Raw", Impl::kRaw}, std::pair{"QRVSQLiteDB", Impl::kClass},
                              std::pair{"RawPreserialized", Impl::kRawPreserialized}}) {
      benchmark::RegisterBenchmark((std::string(op) + "/" + name).c_str(), run, impl, updates)
          ->Iterations(1)
          ->Repetitions(repetitions)
          ->ReportAggregatesOnly(true)
          ->Unit(benchmark::kMillisecond)
          ->UseRealTime();
    }
  }
  std::vector<char*> args(argv, argv + argc);
  std::string interleave = "--benchmark_enable_random_interleaving=true";
  args.insert(args.begin() + 1, interleave.data());  // later arguments may override it
  int count = static_cast<int>(args.size());
  benchmark::Initialize(&count, args.data());
  RatioReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  reporter.printRatios();
  benchmark::Shutdown();
  return 0;
}

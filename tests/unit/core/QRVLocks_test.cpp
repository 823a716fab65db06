#include "core/QRVLocks.h"

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <random>
#include <sstream>
#include <thread>

#include "base/QRVLog.h"
#include "support/QRVEventually.h"

namespace {

using namespace std::chrono_literals;

// A lock call made on a thread of its own; the lock it takes is released
// by the test, from the test's thread (locks are not tied to threads).
class Attempt {
 public:
  explicit Attempt(std::function<void()> lock) : thread_([this, lock] {
    lock();
    granted_ = true;
  }) {}
  ~Attempt() { thread_.join(); }
  bool granted() const { return granted_; }
  bool waitGranted() { return QRVEventually([this] { return granted_.load(); }); }
  // Still waiting after a short while: a waiter blocked on a condition
  // variable shows nothing else.
  bool stillWaiting() {
    std::this_thread::sleep_for(30ms);
    return !granted_;
  }

 private:
  std::atomic<bool> granted_{false};
  std::thread thread_;
};

uint64_t refCount(const std::string& identifier) {
  auto record = TEST_lock_record_snapshot(identifier);
  return record ? record->refCount : 0;
}

class LocksTest : public testing::Test {
 protected:
  // Every test leaves the process-wide table as it found it: empty.
  void SetUp() override { expectIdle(); }
  void TearDown() override { expectIdle(); }
  static void expectIdle() {
    QRVLockTableSnapshot s = TEST_lock_table_snapshot();
    EXPECT_EQ(s.recordCount, 0u);
    EXPECT_EQ(s.allReaderWriterState, 0);
    EXPECT_EQ(s.identifierReaderCount + s.identifierWriterCount, 0u);
  }
};

// --- Coexistence -------------------------------------------------------------

TEST_F(LocksTest, ReadersShareAWriterExcludesOnlyItsOwnAndAWaitingWriterHoldsBackNewReaders) {
  lock_identifier_for_reading("X");
  lock_identifier_for_reading("X");
  EXPECT_EQ(TEST_lock_record_snapshot("X")->lockState, 2);
  {
    Attempt writer([] { lock_identifier_for_writing("X"); });
    ASSERT_TRUE(QRVEventually([] { return refCount("X") == 3; }));  // counted as a waiter
    Attempt other([] { lock_identifier_for_writing("Y"); });
    EXPECT_TRUE(other.waitGranted());
    Attempt reader([] { lock_identifier_for_reading("X"); });
    ASSERT_TRUE(QRVEventually([] { return refCount("X") == 4; }));
    EXPECT_TRUE(writer.stillWaiting());
    EXPECT_FALSE(reader.granted());
    unlock_identifier("X");
    EXPECT_TRUE(writer.stillWaiting());
    unlock_identifier("X");
    EXPECT_TRUE(writer.waitGranted());
    EXPECT_EQ(TEST_lock_record_snapshot("X")->lockState, -1);
    EXPECT_FALSE(reader.granted());
    unlock_identifier("X");
    EXPECT_TRUE(reader.waitGranted());
  }
  unlock_identifier("X");
  unlock_identifier("Y");
}

TEST_F(LocksTest, GlobalReadCoexistsWithIdentifierReadersButNotWriters) {
  lock_identifier_for_reading("X");
  {
    Attempt globalRead([] { lock_all_identifiers_for_reading(); });
    EXPECT_TRUE(globalRead.waitGranted());
  }
  lock_all_identifiers_for_reading();  // global readers share too
  EXPECT_EQ(TEST_lock_table_snapshot().allReaderWriterState, 2);
  {
    Attempt writer([] { lock_identifier_for_writing("Y"); });
    EXPECT_TRUE(writer.stillWaiting());
    EXPECT_EQ(TEST_lock_table_snapshot().identifierWriterCount, 0u);  // waits before being counted
    unlock_all_identifiers();
    EXPECT_TRUE(writer.stillWaiting());
    unlock_all_identifiers();
    EXPECT_TRUE(writer.waitGranted());
  }
  // And a global reader waits for the identifier writer.
  {
    Attempt globalRead([] { lock_all_identifiers_for_reading(); });
    EXPECT_TRUE(globalRead.stillWaiting());
    unlock_identifier("Y");
    EXPECT_TRUE(globalRead.waitGranted());
  }
  unlock_all_identifiers();
  unlock_identifier("X");
}

TEST_F(LocksTest, GlobalWriteWaitsForEveryHolderAndThenExcludesEverything) {
  lock_identifier_for_reading("X");
  lock_identifier_for_writing("Y");
  {
    Attempt globalWrite([] { lock_all_identifiers_for_writing(); });
    EXPECT_TRUE(globalWrite.stillWaiting());
    unlock_identifier("X");
    EXPECT_TRUE(globalWrite.stillWaiting());
    unlock_identifier("Y");
    EXPECT_TRUE(globalWrite.waitGranted());
  }
  EXPECT_EQ(TEST_lock_table_snapshot().allReaderWriterState, -1);
  {
    Attempt reader([] { lock_identifier_for_reading("X"); });
    Attempt writer([] { lock_identifier_for_writing("Z"); });
    Attempt globalRead([] { lock_all_identifiers_for_reading(); });
    Attempt globalWrite([] { lock_all_identifiers_for_writing(); });
    EXPECT_TRUE(reader.stillWaiting() && writer.stillWaiting() && globalRead.stillWaiting() &&
                globalWrite.stillWaiting());
    EXPECT_EQ(TEST_lock_table_snapshot().recordCount, 0u);  // none got as far as a record
    // Everyone gets through once each releases as soon as it is granted; a
    // granted global lock shows in the state (only these attempts hold one).
    bool readerDone = false, writerDone = false;
    int globalReleases = 0;
    unlock_all_identifiers();
    bool done = QRVEventually([&] {
      if (reader.granted() && !readerDone) unlock_identifier("X"), readerDone = true;
      if (writer.granted() && !writerDone) unlock_identifier("Z"), writerDone = true;
      if (TEST_lock_table_snapshot().allReaderWriterState != 0) unlock_all_identifiers(), globalReleases++;
      return readerDone && writerDone && globalReleases == 2;
    });
    ASSERT_TRUE(done);
    EXPECT_TRUE(globalRead.waitGranted() && globalWrite.waitGranted());
  }
}

// --- Order and records ---------------------------------------------------------

TEST_F(LocksTest, AnArrayIsTakenAscendingOnceAndHeldUntilItsLastHolderGoes) {
  // With A held elsewhere, [B, A, B] stops at A before it has touched B.
  lock_identifier_for_writing("A");
  {
    Attempt array([] { lock_identifier_for_writing({"B", "A", "B"}); });
    ASSERT_TRUE(QRVEventually([] { return refCount("A") == 2; }));
    EXPECT_FALSE(TEST_lock_record_snapshot("B").has_value());
    unlock_identifier("A");
    ASSERT_TRUE(array.waitGranted());
  }
  EXPECT_EQ(refCount("A"), 1u);  // each once
  EXPECT_EQ(refCount("B"), 1u);
  // A waiter keeps the record alive past its first holder.
  {
    Attempt waiter([] { lock_identifier_for_reading("B"); });
    ASSERT_TRUE(QRVEventually([] { return refCount("B") == 2; }));
    unlock_identifier(std::vector<std::string>{"B", "A", "B"});
    ASSERT_TRUE(waiter.waitGranted());
  }
  EXPECT_EQ(TEST_lock_record_snapshot("B")->lockState, 1);
  EXPECT_FALSE(TEST_lock_record_snapshot("A").has_value());
  unlock_identifier("B");
  lock_identifier_for_reading(std::vector<std::string>{});  // an empty list takes nothing
  EXPECT_EQ(TEST_lock_table_snapshot().recordCount, 0u);
}

TEST_F(LocksTest, AnArrayIsReleasedInTheReverseOrderOfTaking) {
  // Only the log tells the order of releases apart.
  const std::string logPath = ::testing::TempDir() + "locks-order.log";
  std::filesystem::remove(logPath);
  ASSERT_TRUE(QRVLog::open("test", logPath, QRVLogLevel::kDebug, 1, 1 << 20));
  lock_identifier_for_writing(std::vector<std::string>{"B", "A", "B"});
  unlock_identifier(std::vector<std::string>{"B", "A", "B"});
  QRVLog::close();
  std::stringstream log;
  log << std::ifstream(logPath).rdbuf();
  const std::string text = log.str();
  const size_t b = text.find("Unlocked identifier B");
  const size_t a = text.find("Unlocked identifier A");
  ASSERT_NE(b, std::string::npos) << text;
  ASSERT_NE(a, std::string::npos) << text;
  EXPECT_LT(b, a) << text;
  EXPECT_EQ(text.find("Unlocked identifier B", b + 1), std::string::npos) << "B released twice:\n" << text;
  EXPECT_LT(text.find("Got lock on identifier A"), text.find("Got lock on identifier B")) << text;
  EXPECT_EQ(TEST_lock_table_snapshot().recordCount, 0u);
  std::filesystem::remove(logPath);
}

TEST_F(LocksTest, GuardsReleaseOnScopeExitOnUnlockAndAfterAMove) {
  {
    QRVIdentifierWriteLock write(std::vector<std::string>{"A", "B", "A"});
    EXPECT_EQ(TEST_lock_table_snapshot().identifierWriterCount, 2u);
  }
  EXPECT_EQ(TEST_lock_table_snapshot().recordCount, 0u);
  {
    QRVGlobalReadLock read;
    EXPECT_EQ(TEST_lock_table_snapshot().allReaderWriterState, 1);
    read.unlock();
    EXPECT_FALSE(read.ownsLock());
    EXPECT_EQ(TEST_lock_table_snapshot().allReaderWriterState, 0);
  }  // and the destructor does not release a second time (that would be fatal)
  {
    QRVGlobalWriteLock write;
    QRVGlobalLockGuard moved = std::move(write);
    EXPECT_FALSE(write.ownsLock());
    EXPECT_EQ(TEST_lock_table_snapshot().allReaderWriterState, -1);
  }
  // A guard handed to another thread is released there.
  QRVIdentifierLockGuard guard("X", QRVLockMode::kWrite);
  std::thread([g = std::move(guard)] { EXPECT_EQ(refCount("X"), 1u); }).join();
  EXPECT_FALSE(guard.ownsLock());
  EXPECT_FALSE(TEST_lock_record_snapshot("X").has_value());
}

// --- Invariants ----------------------------------------------------------------

TEST_F(LocksTest, BrokenInvariantsEndTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(unlock_one_lock("never-locked"), "Unlocking identifier never-locked");
  EXPECT_DEATH(unlock_all_identifiers(), "no all-identifiers lock is held");
  EXPECT_DEATH(lock_identifier_for_reading(QRVLockParameter::fromPlist(QRVPlist::uinteger(5))),
               "Unknown parameter type!");
  EXPECT_DEATH(unlock_identifier(QRVLockParameter::fromPlist(
                   QRVPlist::array({QRVPlist::string("A"), QRVPlist::boolean(true)}))),
               "Unknown parameter type!");
  EXPECT_DEATH(
      {
        lock_identifier_for_reading("X");
        unlock_identifier("X");
        unlock_identifier("X");
      },
      "Unlocking identifier X which has no lock");
}

// --- Stress --------------------------------------------------------------------

// Many threads lock random sets of identifiers and the global lock in every
// mode, checking with their own counters that no two incompatible holders
// ever overlap, and must all finish.
TEST_F(LocksTest, RandomLockingKeepsExclusionAndFinishes) {
  constexpr int kThreads = 8, kIdentifiers = 6, kIterations = 4000;
  struct Counters {
    std::atomic<int> readers{0}, writers{0};
  };
  std::array<Counters, kIdentifiers> ids;
  Counters global;
  std::atomic<int> violations{0}, finished{0};
  auto name = [](int i) { return "id-" + std::to_string(i); };

  auto worker = [&](unsigned seed) {
    std::mt19937 random(seed);
    for (int iteration = 0; iteration < kIterations; iteration++) {
      int kind = random() % 10;
      if (kind == 0) {
        QRVGlobalWriteLock lock;
        if (global.writers++ || global.readers) violations++;
        for (auto& c : ids)
          if (c.readers || c.writers) violations++;
        std::this_thread::yield();
        global.writers--;
      } else if (kind == 1) {
        QRVGlobalReadLock lock;
        global.readers++;
        if (global.writers) violations++;
        for (auto& c : ids)
          if (c.writers) violations++;
        std::this_thread::yield();
        global.readers--;
      } else {
        std::vector<std::string> names;
        std::vector<int> chosen;
        for (int n = 1 + random() % 3; n > 0; n--) {
          int i = random() % kIdentifiers;
          names.push_back(name(i));
          if (std::find(chosen.begin(), chosen.end(), i) == chosen.end()) chosen.push_back(i);
        }
        bool write = kind >= 6;
        QRVIdentifierLockGuard lock(names, write ? QRVLockMode::kWrite : QRVLockMode::kRead);
        if (global.writers || (write && global.readers)) violations++;
        for (int i : chosen) {
          if (write ? (ids[i].writers++ || ids[i].readers) : (ids[i].readers++, ids[i].writers.load() != 0))
            violations++;
        }
        std::this_thread::yield();
        for (int i : chosen) (write ? ids[i].writers : ids[i].readers)--;
      }
    }
    finished++;
  };

  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; t++) threads.emplace_back(worker, 1234u + t);
  if (!QRVEventually([&] { return finished == kThreads; }, 180s)) {
    // Deadlocked threads cannot be joined: say so and stop here.
    ADD_FAILURE() << "lock stress test deadlocked";
    std::abort();
  }
  for (auto& t : threads) t.join();
  EXPECT_EQ(violations, 0);
}

}  // namespace

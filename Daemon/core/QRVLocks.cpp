#include "core/QRVLocks.h"

#include <algorithm>
#include <atomic>
#include <climits>
#include <memory>
#include <unordered_map>

#include "base/QRVCondVar.h"
#include "base/QRVLog.h"
#include "base/QRVMutex.h"
#include "core/QRVExceptionReporter.h"

namespace {

// One identifier's lock. The reader/writer lock is built from the record's
// own mutex and condition variable rather than a pthread rwlock, because a
// pthread write lock must be released by the thread that took it and our
// callers hand locks across queues.
struct LockRecord {
  QRVMutex mutex;  // taken after the table mutex, never before it
  QRVCondVar changed;
  uint32_t writersWaiting GUARDED_BY(mutex) = 0;
  std::atomic<int32_t> lockState{0};  // 0 free, -1 write-held, n readers; changed under `mutex`
  // Holders plus waiters. Guarded by the table's mutex, not this record's:
  // the analysis cannot name the mutex of another object, so this one is
  // checked by reading take_one_lock and unlock_one_lock only.
  uint64_t refCount = 0;
};

struct LockTable {
  QRVMutex mutex;
  // Made on first use, like every record in it.
  std::unique_ptr<std::unordered_map<std::string, std::unique_ptr<LockRecord>>> identifierToLockMap GUARDED_BY(mutex)
      PT_GUARDED_BY(mutex);
  int32_t allReaderWriterState GUARDED_BY(mutex) = 0;    // 0 none, -1 all-write held, n all-read holders
  uint32_t identifierReaderCount GUARDED_BY(mutex) = 0;  // read locks taken or being taken
  uint32_t identifierWriterCount GUARDED_BY(mutex) = 0;  // write locks taken or being taken
  // (a) identifier writers wait for no all-identifiers lock at all.
  QRVCondVar identifierWritersWaitForNoGlobal;
  // (b) identifier readers wait for no all-identifiers writer.
  QRVCondVar identifierReadersWaitForNoGlobalWriter;
  // (c) an all-identifiers writer waits for nothing held.
  QRVCondVar globalWriterWaitsForNothingHeld;
  // (d) all-identifiers readers wait for no identifier writer and no
  // all-identifiers writer.
  QRVCondVar globalReadersWaitForNoWriter;

  bool nothingHeld() const REQUIRES(mutex) {
    return identifierReaderCount == 0 && identifierWriterCount == 0 && allReaderWriterState == 0;
  }
};

// Never destroyed: a queue thread may still unlock while the process exits.
LockTable& gQRVLocks() {
  static LockTable* table = new LockTable;
  return *table;
}

const char* modeName(QRVLockMode mode) { return mode == QRVLockMode::kWrite ? "writing" : "reading"; }

[[noreturn]] void invariantBroken(const std::string& message) { QRVTerminate(message); }

[[noreturn]] void unknownParameter() { QRVTerminate("Unknown parameter type!"); }

// The identifiers of an array, each once, in ascending order.
std::vector<std::string> ascendingUnique(const std::vector<std::string>& identifiers) {
  std::vector<std::string> sorted = identifiers;
  std::sort(sorted.begin(), sorted.end());
  sorted.erase(std::unique(sorted.begin(), sorted.end()), sorted.end());
  return sorted;
}

void lock_identifier_in_mode(const QRVLockParameter& parameter, QRVLockMode mode) {
  if (const std::string* identifier = parameter.identifier()) {
    take_one_lock(*identifier, mode);
  } else if (const std::vector<std::string>* identifiers = parameter.identifiers()) {
    // A fixed global order: two callers locking overlapping sets never wait
    // for each other in a circle.
    for (const std::string& each : ascendingUnique(*identifiers)) take_one_lock(each, mode);
  } else {
    unknownParameter();
  }
}

void lock_all_identifiers_in_mode(QRVLockMode mode) {
  QRVLogDebug("Waiting to lock all identifiers for {}", modeName(mode));
  LockTable& t = gQRVLocks();
  {
    QRVMutexLock lock(&t.mutex);
    if (mode == QRVLockMode::kWrite) {
      while (!t.nothingHeld()) t.globalWriterWaitsForNothingHeld.wait(&t.mutex);
      t.allReaderWriterState = -1;
    } else {
      while (t.identifierWriterCount != 0 || t.allReaderWriterState == -1)
        t.globalReadersWaitForNoWriter.wait(&t.mutex);
      if (t.allReaderWriterState == INT32_MAX) invariantBroken("Too many holders of the all-identifiers read lock");
      t.allReaderWriterState++;
    }
  }
  QRVLogDebug("Locked all identifiers for {}", modeName(mode));
}

}  // namespace

QRVLockParameter QRVLockParameter::fromPlist(const QRVPlist& value) {
  if (value.isString()) return QRVLockParameter(value.stringValue());
  if (value.isArray()) {
    std::vector<std::string> identifiers;
    for (const QRVPlist& element : value.arrayValue()) {
      if (!element.isString()) return QRVLockParameter(Unknown{});
      identifiers.push_back(element.stringValue());
    }
    return QRVLockParameter(std::move(identifiers));
  }
  return QRVLockParameter(Unknown{});
}

void take_one_lock(const std::string& identifier, QRVLockMode mode) {
  const bool writer = mode == QRVLockMode::kWrite;
  LockTable& t = gQRVLocks();
  LockRecord* record;
  {
    QRVMutexLock lock(&t.mutex);
    if (writer) {
      while (t.allReaderWriterState != 0) t.identifierWritersWaitForNoGlobal.wait(&t.mutex);
      t.identifierWriterCount++;
    } else {
      while (t.allReaderWriterState == -1) t.identifierReadersWaitForNoGlobalWriter.wait(&t.mutex);
      t.identifierReaderCount++;
    }
    if (!t.identifierToLockMap)
      t.identifierToLockMap = std::make_unique<std::unordered_map<std::string, std::unique_ptr<LockRecord>>>();
    std::unique_ptr<LockRecord>& slot = (*t.identifierToLockMap)[identifier];
    if (!slot) slot = std::make_unique<LockRecord>();
    record = slot.get();
    // Our count keeps the record alive once the table mutex is gone.
    record->refCount++;
  }

  QRVLogDebug("Waiting to lock {} for {}", identifier, modeName(mode));
  // Waiting here holds only the record's mutex (released while asleep), so
  // a contended identifier never blocks the table.
  {
    QRVMutexLock lock(&record->mutex);
    if (writer) {
      record->writersWaiting++;
      while (record->lockState.load() != 0) record->changed.wait(&record->mutex);
      record->writersWaiting--;
      int32_t expected = 0;
      if (!record->lockState.compare_exchange_strong(expected, -1))
        invariantBroken(fmt::format("Write lock on identifier {} found lock state {}", identifier, expected));
    } else {
      // A waiting writer holds back new readers, so it is never starved.
      while (record->lockState.load() < 0 || record->writersWaiting != 0) record->changed.wait(&record->mutex);
      int32_t previous = record->lockState.fetch_add(1);
      if (previous < 0)
        invariantBroken(fmt::format("Read lock on identifier {} found lock state {}", identifier, previous));
    }
  }
  QRVLogDebug("Got lock on identifier {}", identifier);
}

void unlock_one_lock(const std::string& identifier) {
  LockTable& t = gQRVLocks();
  bool destroyed = false;
  {
    QRVMutexLock lock(&t.mutex);
    if (!t.identifierToLockMap)
      invariantBroken(fmt::format("Unlocking identifier {} before any identifier was locked", identifier));
    auto it = t.identifierToLockMap->find(identifier);
    if (it == t.identifierToLockMap->end())
      invariantBroken(fmt::format("Unlocking identifier {} which has no lock", identifier));
    LockRecord* record = it->second.get();
    const int32_t state = record->lockState.load();
    if (state == 0) invariantBroken(fmt::format("Unlocking identifier {} which is not locked", identifier));

    const bool reader = state != -1;
    if (reader) {
      if (t.allReaderWriterState < 0)
        invariantBroken(fmt::format("Identifier {} was read-locked under the all-identifiers write lock", identifier));
      if (t.identifierReaderCount == 0)
        invariantBroken(fmt::format("Unlocking reader of {} with no identifier readers counted", identifier));
      t.identifierReaderCount--;
      if (t.nothingHeld()) t.globalWriterWaitsForNothingHeld.signal();
    } else {
      if (t.allReaderWriterState != 0)
        invariantBroken(fmt::format("Identifier {} was write-locked under an all-identifiers lock (state {})",
                                    identifier, t.allReaderWriterState));
      if (t.identifierWriterCount == 0)
        invariantBroken(fmt::format("Unlocking writer of {} with no identifier writers counted", identifier));
      t.identifierWriterCount--;
      if (t.nothingHeld()) t.globalWriterWaitsForNothingHeld.signal();
      if (t.identifierWriterCount == 0 && t.allReaderWriterState != -1) t.globalReadersWaitForNoWriter.signalAll();
    }

    record->refCount--;
    {
      QRVMutexLock recordLock(&record->mutex);
      if (reader) {
        int32_t previous = record->lockState.fetch_sub(1);
        if (previous <= 0)
          invariantBroken(fmt::format("Read unlock of identifier {} found lock state {}", identifier, previous));
      } else {
        int32_t expected = -1;
        if (!record->lockState.compare_exchange_strong(expected, 0))
          invariantBroken(fmt::format("Write unlock of identifier {} found lock state {}", identifier, expected));
      }
    }
    record->changed.signalAll();

    // Nobody holds or waits for it (waiters are counted): safe to free.
    if (record->refCount == 0) {
      if (record->lockState.load() != 0)
        invariantBroken(fmt::format("Destroying lock for identifier {} while it is held", identifier));
      t.identifierToLockMap->erase(it);
      destroyed = true;
    }
  }
  QRVLogDebug("Unlocked identifier {}", identifier);
  if (destroyed) QRVLogDebug("Destroying lock for identifier {}", identifier);
}

void lock_identifier_for_reading(const QRVLockParameter& parameter) {
  lock_identifier_in_mode(parameter, QRVLockMode::kRead);
}

void lock_identifier_for_writing(const QRVLockParameter& parameter) {
  lock_identifier_in_mode(parameter, QRVLockMode::kWrite);
}

void unlock_identifier(const QRVLockParameter& parameter) {
  if (const std::string* identifier = parameter.identifier()) {
    unlock_one_lock(*identifier);
  } else if (const std::vector<std::string>* identifiers = parameter.identifiers()) {
    std::vector<std::string> sorted = ascendingUnique(*identifiers);
    // The reverse of the order of taking.
    for (auto it = sorted.rbegin(); it != sorted.rend(); ++it) unlock_one_lock(*it);
  } else {
    unknownParameter();
  }
}

void lock_all_identifiers_for_reading() { lock_all_identifiers_in_mode(QRVLockMode::kRead); }

void lock_all_identifiers_for_writing() { lock_all_identifiers_in_mode(QRVLockMode::kWrite); }

void unlock_all_identifiers() {
  LockTable& t = gQRVLocks();
  {
    QRVMutexLock lock(&t.mutex);
    if (t.allReaderWriterState != -1) {
      if (t.allReaderWriterState <= 0) invariantBroken("Unlocking all identifiers, but no all-identifiers lock is held");
      t.allReaderWriterState--;
      if (t.allReaderWriterState == 0) t.identifierWritersWaitForNoGlobal.signalAll();
      if (t.nothingHeld()) t.globalWriterWaitsForNothingHeld.signal();
    } else {
      t.allReaderWriterState = 0;
      t.globalWriterWaitsForNothingHeld.signal();
      t.globalReadersWaitForNoWriter.signalAll();
      t.identifierWritersWaitForNoGlobal.signalAll();
      t.identifierReadersWaitForNoGlobalWriter.signalAll();
    }
  }
  QRVLogDebug("Unlocked all identifiers");
}

QRVLockTableSnapshot TEST_lock_table_snapshot() {
  LockTable& t = gQRVLocks();
  QRVMutexLock lock(&t.mutex);
  QRVLockTableSnapshot s;
  s.recordCount = t.identifierToLockMap ? t.identifierToLockMap->size() : 0;
  s.allReaderWriterState = t.allReaderWriterState;
  s.identifierReaderCount = t.identifierReaderCount;
  s.identifierWriterCount = t.identifierWriterCount;
  return s;
}

std::optional<QRVLockRecordSnapshot> TEST_lock_record_snapshot(const std::string& identifier) {
  LockTable& t = gQRVLocks();
  QRVMutexLock lock(&t.mutex);
  if (!t.identifierToLockMap) return std::nullopt;
  auto it = t.identifierToLockMap->find(identifier);
  if (it == t.identifierToLockMap->end()) return std::nullopt;
  return QRVLockRecordSnapshot{it->second->refCount, it->second->lockState.load()};
}

// --- Guards ---------------------------------------------------------------

QRVIdentifierLockGuard::QRVIdentifierLockGuard(QRVLockParameter parameter, QRVLockMode mode)
    : parameter_(std::move(parameter)) {
  lock_identifier_in_mode(parameter_, mode);
  held_ = true;
}

QRVIdentifierLockGuard::QRVIdentifierLockGuard(QRVIdentifierLockGuard&& other) noexcept
    : parameter_(std::move(other.parameter_)), held_(other.held_) {
  other.held_ = false;
}

QRVIdentifierLockGuard& QRVIdentifierLockGuard::operator=(QRVIdentifierLockGuard&& other) noexcept {
  if (this != &other) {
    unlock();
    parameter_ = std::move(other.parameter_);
    held_ = other.held_;
    other.held_ = false;
  }
  return *this;
}

void QRVIdentifierLockGuard::unlock() {
  if (!held_) return;
  held_ = false;
  unlock_identifier(parameter_);
}

QRVGlobalLockGuard::QRVGlobalLockGuard(QRVLockMode mode) {
  lock_all_identifiers_in_mode(mode);
  held_ = true;
}

QRVGlobalLockGuard& QRVGlobalLockGuard::operator=(QRVGlobalLockGuard&& other) noexcept {
  if (this != &other) {
    unlock();
    held_ = other.held_;
    other.held_ = false;
  }
  return *this;
}

void QRVGlobalLockGuard::unlock() {
  if (!held_) return;
  held_ = false;
  unlock_all_identifiers();
}

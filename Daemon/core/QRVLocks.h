// Identifier locks: the one lock that every container operation shares.
//
// Work on a container (from client requests, the death-row queue, data
// protection changes, the code-signing mapping) is kept apart by
// reader/writer locks keyed by identifier text, in practice the container's
// UUID string. A lock record exists only while somebody holds or waits for
// it. Beside them there is one "all identifiers" lock: a bulk operation takes
// it for writing to exclude every single-identifier holder, or for reading to
// run beside single-identifier readers (but never beside a writer).
//
// Coexistence (different identifiers never conflict with each other):
//
//   held \ wanted         | read same id | write same id | all read | all write
//   ----------------------+--------------+---------------+----------+----------
//   read lock on an id    |     yes      |      no       |   yes    |    no
//   write lock on an id   |      no      |      no       |    no    |    no
//   all-identifiers read  |     yes      |      no       |   yes    |    no
//   all-identifiers write |      no      |      no       |    no    |    no
//
// (For the all-identifiers rows, "same id" means any identifier.)
//
// Rules for callers:
//  1. Several identifiers are taken in one call, as an array: the module takes
//     them in ascending order (duplicates once) and releases them in
//     descending order, so two callers locking overlapping sets cannot
//     deadlock. Never take a second identifier lock while holding one.
//  2. Never ask for the all-identifiers lock while holding an identifier lock.
//  3. While holding the all-identifiers write lock take no identifier lock:
//     it already covers them, and asking would wait for yourself. While
//     holding it for reading, identifier read locks may be taken but not
//     write locks, for the same reason.
//  4. Locks are not recursive: locking an identifier you already hold for
//     writing waits forever, and re-reading one while a writer waits does too
//     (a waiting writer holds new readers back so that it is not starved).
//  5. Every lock is released exactly once, on every path. Prefer the guards
//     at the end of this file. A lock may be released on another thread than
//     the one that took it (work that hops queues).
//
// A broken invariant (releasing what is not held, counts going negative) is a
// programming error: the process ends with a message saying which.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "base/QRVPlist.h"

enum class QRVLockMode { kRead, kWrite };

// What a lock call names: one identifier or a list of them. Anything else
// (a parameter made from a property list of another type) is a programming
// error that ends the process with "Unknown parameter type!".
class QRVLockParameter {
 public:
  struct Unknown {};

  QRVLockParameter(std::string identifier) : value_(std::move(identifier)) {}
  QRVLockParameter(const char* identifier) : value_(std::string(identifier)) {}
  QRVLockParameter(std::vector<std::string> identifiers) : value_(std::move(identifiers)) {}
  QRVLockParameter(std::initializer_list<std::string> identifiers)
      : value_(std::vector<std::string>(identifiers)) {}
  QRVLockParameter(Unknown) : value_(Unknown{}) {}

  // A string is one identifier, an array of strings a list; anything else
  // (including an array holding a non-string) is Unknown.
  static QRVLockParameter fromPlist(const QRVPlist& value);

  const std::string* identifier() const { return std::get_if<std::string>(&value_); }
  const std::vector<std::string>* identifiers() const { return std::get_if<std::vector<std::string>>(&value_); }
  bool isUnknown() const { return std::holds_alternative<Unknown>(value_); }

 private:
  std::variant<std::string, std::vector<std::string>, Unknown> value_;
};

// --- Primitives -----------------------------------------------------------
// Each lock call blocks until granted and must be paired with exactly one
// matching unlock call given the same parameter.

void lock_identifier_for_reading(const QRVLockParameter& parameter);
void lock_identifier_for_writing(const QRVLockParameter& parameter);
// Releases what the matching lock call took (the mode is remembered per
// identifier).
void unlock_identifier(const QRVLockParameter& parameter);

void lock_all_identifiers_for_reading();
void lock_all_identifiers_for_writing();
// Releases the all-identifiers lock, read or write, whichever is held.
void unlock_all_identifiers();

// One identifier. Callers normally go through the functions above.
void take_one_lock(const std::string& identifier, QRVLockMode mode);
void unlock_one_lock(const std::string& identifier);

// --- Test hooks -----------------------------------------------------------

struct QRVLockTableSnapshot {
  size_t recordCount = 0;             // live per-identifier records
  int32_t allReaderWriterState = 0;   // 0 none, -1 all-write, n all-read holders
  uint32_t identifierReaderCount = 0; // taken or being taken
  uint32_t identifierWriterCount = 0;
};
QRVLockTableSnapshot TEST_lock_table_snapshot();

struct QRVLockRecordSnapshot {
  uint64_t refCount = 0;  // holders plus waiters
  int32_t lockState = 0;  // 0 free, -1 write-held, n readers
};
// None when the identifier has no record (nobody holds or waits for it).
std::optional<QRVLockRecordSnapshot> TEST_lock_record_snapshot(const std::string& identifier);

// --- Guards ---------------------------------------------------------------
// Scoped forms of the primitives: the lock is held from construction until
// destruction or `unlock()`. Movable, so a lock can be handed to the code that
// finishes the work (possibly on another thread).

class QRVIdentifierLockGuard {
 public:
  QRVIdentifierLockGuard(QRVLockParameter parameter, QRVLockMode mode);
  ~QRVIdentifierLockGuard() { unlock(); }
  QRVIdentifierLockGuard(QRVIdentifierLockGuard&& other) noexcept;
  QRVIdentifierLockGuard& operator=(QRVIdentifierLockGuard&& other) noexcept;
  QRVIdentifierLockGuard(const QRVIdentifierLockGuard&) = delete;
  QRVIdentifierLockGuard& operator=(const QRVIdentifierLockGuard&) = delete;

  // Releases early; the destructor then does nothing.
  void unlock();
  bool ownsLock() const { return held_; }

 private:
  QRVLockParameter parameter_;
  bool held_ = false;
};

class QRVGlobalLockGuard {
 public:
  explicit QRVGlobalLockGuard(QRVLockMode mode);
  ~QRVGlobalLockGuard() { unlock(); }
  QRVGlobalLockGuard(QRVGlobalLockGuard&& other) noexcept : held_(other.held_) { other.held_ = false; }
  QRVGlobalLockGuard& operator=(QRVGlobalLockGuard&& other) noexcept;
  QRVGlobalLockGuard(const QRVGlobalLockGuard&) = delete;
  QRVGlobalLockGuard& operator=(const QRVGlobalLockGuard&) = delete;

  void unlock();
  bool ownsLock() const { return held_; }

 private:
  bool held_ = false;
};

// Shorthands that read as what they do at the call site.
struct QRVIdentifierReadLock : QRVIdentifierLockGuard {
  explicit QRVIdentifierReadLock(QRVLockParameter p) : QRVIdentifierLockGuard(std::move(p), QRVLockMode::kRead) {}
};
struct QRVIdentifierWriteLock : QRVIdentifierLockGuard {
  explicit QRVIdentifierWriteLock(QRVLockParameter p) : QRVIdentifierLockGuard(std::move(p), QRVLockMode::kWrite) {}
};
struct QRVGlobalReadLock : QRVGlobalLockGuard {
  QRVGlobalReadLock() : QRVGlobalLockGuard(QRVLockMode::kRead) {}
};
struct QRVGlobalWriteLock : QRVGlobalLockGuard {
  QRVGlobalWriteLock() : QRVGlobalLockGuard(QRVLockMode::kWrite) {}
};

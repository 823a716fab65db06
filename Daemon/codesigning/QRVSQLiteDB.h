// The code-signing database: one SQLite file, "containers.sqlite3", that maps
// each code-signing identifier to its QRVCodeSigningEntry.
//
// Layout. code_signing_info holds one row per identifier with its flags;
// code_signing_data holds the code-signing dictionary of that row as a binary
// property list; child_bundles links each child identifier to exactly one
// parent row. Both hang on code_signing_info(id) with ON DELETE CASCADE, so
// deleting an identifier's row takes its data and its children with it. The
// "placeholder" column is a flag word: bit 0 placeholder, bit 1 advance copy.
//
// Every identifier is bound, never interpolated, and is treated as bytes: an
// identifier may hold quotes, NULs or bytes that are not UTF-8.
//
// Errors (QRVErrorDomain): 38 a required argument is missing; 40 an exception
// was raised inside a transaction; 66 a database operation failed; 67 no such
// identifier, parent or children (not logged); 68 the number of changed rows
// was not the expected one; 73 an allocation failed while reading a row.
//
// Not thread-safe and takes no locks: the code-signing mapping is its only
// user and calls it from its own serial queue.
#pragma once

#include <cstdint>
#include <exception>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/QRVError.h"
#include "codesigning/QRVCodeSigningEntry.h"

struct sqlite3;
class QRVSQLiteStatement;

class QRVSQLiteDB {
 public:
  // Receives an exception caught inside a transaction. An internal build
  // passes the daemon's uncaught-exception reporter, which aborts; without a
  // reporter (or if it returns) the transaction is rolled back and the
  // operation fails with error 40.
  using ExceptionReporter = std::function<void(std::exception_ptr)>;
  // Called once per row of the enumeration. Must not write to the database:
  // the walk's statement is still open while it runs.
  using EnumerationBlock = std::function<void(
      const std::string& identifier, const std::shared_ptr<const QRVCodeSigningEntry>& entry)>;

  // Codes of this component (QRVResultCode): kDatabaseFailed for any failed
  // statement, kDatabaseNotFound (not logged) when no row matches,
  // kDatabaseChangeCount when a statement changed another number of rows
  // than expected, kAllocationFailed when a row cannot be turned into
  // objects.

  // Opens (creating if needed) the database at `url` and runs the schema
  // script. Never returns null: a database that cannot be opened or set up
  // (unreadable, corrupt, held by another process) terminates the daemon,
  // because every entitlement decision depends on it.
  static sqlite3* openDBWithURL(const std::filesystem::path& url);
  // The same without terminating: null with error 66 ("opening ... failed"
  // or "table create for ... failed", both logged) when the file cannot be
  // opened or set up.
  static sqlite3* tryOpenDBWithURL(const std::filesystem::path& url, QRVError* error);

  // Opens "<directory>/containers.sqlite3". Returns null when no file name
  // can be built (an empty directory).
  static std::unique_ptr<QRVSQLiteDB> initWithParentDirectoryURL(
      const std::filesystem::path& directory, ExceptionReporter exceptionReporter = nullptr);
  // The same for callers that can go on without the database: null with
  // error 38 for an empty directory or the opening's error 66.
  static std::unique_ptr<QRVSQLiteDB> tryInitWithParentDirectoryURL(const std::filesystem::path& directory,
                                                                    QRVError* error,
                                                                    ExceptionReporter exceptionReporter = nullptr);

  ~QRVSQLiteDB();
  QRVSQLiteDB(const QRVSQLiteDB&) = delete;
  QRVSQLiteDB& operator=(const QRVSQLiteDB&) = delete;

  // Counts up after every write to any code-signing database of this
  // process, and whenever one is opened or closed, so that what was derived
  // from a database may be kept while the count stays the same. Any thread.
  static uint64_t changeCount();

  // The open connection (null once closed) and the database file.
  sqlite3* db() const { return db_; }
  const std::filesystem::path& url() const { return url_; }

  // Closes the connection; later calls fail with 66. Also done on
  // destruction.
  void closeDB();

  // Stores `entry` under `identifier` in one transaction: the identifier's
  // row is updated in place (its id, and so its existing children, survive)
  // or inserted, its dictionary replaced, and each child identifier of the
  // entry attached to it, moving a child away from any previous parent.
  // Children are only ever added here, never removed. A child that cannot be
  // attached is logged and skipped. A failing COMMIT is logged but still
  // reported as success. Null arguments fail with 38.
  bool addCodeSigningEntry(const QRVCodeSigningEntry* entry,
                           std::optional<std::string_view> identifier, QRVError* error);

  // Deletes the identifier with its dictionary and child rows. An identifier
  // that is not stored fails with 66 wrapping 68; a null one with 38.
  bool deleteCodeSigningEntryWithIdentifier(std::optional<std::string_view> identifier,
                                            QRVError* error);

  // The stored entry, its child list filled in (absent when it has no
  // children). Not stored: 67. A stored dictionary that cannot be read: 66.
  std::shared_ptr<const QRVCodeSigningEntry> codeSigningEntryWithIdentifier(
      std::string_view identifier, QRVError* error);

  // Marks the identifier invalid. An identifier that is not stored succeeds
  // and changes nothing.
  bool invalidateCodeSigningWithIdentifier(std::string_view identifier, QRVError* error);

  // Marks the identifier and each of its children invalid in one
  // transaction. A member that cannot be invalidated is logged and the rest
  // go on; only a failure to read the children or to begin or commit fails.
  bool invalidateCodeSigningForIdentifierAndAllChildren(std::string_view identifier,
                                                        QRVError* error);

  // Calls `block` for every stored identifier and its entry. A row that
  // cannot be read is logged and skipped. Returns the error that ended the
  // walk early, if any.
  std::optional<QRVError> enumerateIdentifiersAndCodeSigningInfoUsingBlock(
      const EnumerationBlock& block);

  // Every stored identifier (empty when there are none).
  std::optional<std::vector<std::string>> identifiersWithError(QRVError* error);

  // The parent's children in database order; none, or no such parent: 67.
  std::optional<std::vector<std::string>> childIdentifiersForParentIdentifier(
      std::string_view parentIdentifier, QRVError* error);

  // The child's parent; no such child: 67.
  std::optional<std::string> parentIdentifierForChildIdentifier(std::string_view childIdentifier,
                                                                QRVError* error);

  // Deletes every advance copy, with its dictionary and child rows.
  bool deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(QRVError* error);

  // Runs inside add's and invalidate-all's transactions, after their
  // statements and just before COMMIT, so tests can raise there.
  void TEST_setInsideTransactionHook(std::function<void()> hook) { testHook_ = std::move(hook); }

 private:
  // Rolls back a transaction that a failed COMMIT left open.
  void _endFailedCommit();
  QRVSQLiteDB(sqlite3* db, std::filesystem::path url, ExceptionReporter exceptionReporter);

  bool _performTwoParameterQuery(const char* sql, std::string_view textOne,
                                 std::optional<std::string_view> textTwo, int expectedChanges,
                                 QRVError* error);
  bool _performSingleParameterQuery(const char* sql, std::string_view text, int expectedChanges,
                                    QRVError* error);
  bool _performSingleParameterQuery(const char* sql, std::string_view text, QRVError* error);
  bool _performInsertOrUpdateQuery(const char* sql, const QRVCodeSigningEntry& entry,
                                   std::string_view identifier, bool isUpdate, QRVError* error);
  bool _insertCodeSigningInfo(const QRVCodeSigningEntry& entry, std::string_view identifier,
                              QRVError* error);
  bool _insertCodeSigningData(const QRVCodeSigningEntry& entry, std::string_view identifier,
                              QRVError* error);
  bool _insertChildIdentifier(std::string_view child, std::string_view parent, QRVError* error);
  std::shared_ptr<QRVCodeSigningEntry> _codeSigningEntryFromStatementRow(const QRVSQLiteStatement& statement,
                                                                         QRVError* error);
  bool _sqliteExec(const char* statement, QRVError* error);

  // Turns an exception caught between BEGIN and COMMIT into error 40 after
  // handing it to the reporter and rolling back.
  bool _failInsideTransaction(std::exception_ptr exception, QRVError* error);
  void _runTestHook() {
    if (testHook_) testHook_();
  }

  sqlite3* db_;
  const std::filesystem::path url_;
  const ExceptionReporter exceptionReporter_;
  std::function<void()> testHook_;
};

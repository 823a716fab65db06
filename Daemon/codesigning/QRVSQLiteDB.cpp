#include "codesigning/QRVSQLiteDB.h"

#include <cxxabi.h>
#include <sqlite3.h>
#include <unistd.h>

#include <cstdlib>
#include <new>
#include <typeinfo>
#include <utility>

#include "base/QRVLog.h"

namespace {

// The statements are part of the file format: another build of the daemon
// opens the same file, so they are kept exactly as they are.
//
// Note on the pragmas: journal_mode = WAL writes the header of a new file
// before auto_vacuum = FULL runs, and SQLite only honours auto_vacuum on a
// file without a header, so a file created by this script does not
// auto-vacuum. The script is kept as it is so that existing databases and new
// ones agree.
constexpr const char* kSchemaScript =
    "PRAGMA locking_mode = EXCLUSIVE;PRAGMA journal_mode = WAL;PRAGMA foreign_keys = ON;PRAGMA "
    "auto_vacuum = FULL;CREATE TABLE IF NOT EXISTS code_signing_info(id INTEGER PRIMARY KEY "
    "AUTOINCREMENT,code_signing_id_text TEXT NOT NULL UNIQUE,invalid INTEGER NOT NULL DEFAULT "
    "0,placeholder INTEGER NOT NULL DEFAULT 0,registered_by_caller INTEGER NOT NULL DEFAULT "
    "0,data_container_class INTEGER NOT NULL DEFAULT 0);CREATE TABLE IF NOT EXISTS "
    "code_signing_data(id INTEGER PRIMARY KEY AUTOINCREMENT,cs_info_id INTEGER NOT NULL "
    "UNIQUE,data BLOB NOT NULL,FOREIGN KEY(cs_info_id) REFERENCES code_signing_info(id) ON "
    "DELETE CASCADE);CREATE TABLE IF NOT EXISTS child_bundles(id INTEGER PRIMARY KEY "
    "AUTOINCREMENT,child_code_signing_id_text TEXT NOT NULL UNIQUE,parent_id INTEGER NOT "
    "NULL,FOREIGN KEY(parent_id) REFERENCES code_signing_info(id) ON DELETE CASCADE);CREATE "
    "INDEX IF NOT EXISTS code_signing_id_text_idx ON code_signing_info(code_signing_id_text);"
    "CREATE INDEX IF NOT EXISTS cs_info_id_idx ON code_signing_data(cs_info_id);CREATE INDEX IF "
    "NOT EXISTS parent_id_idx ON child_bundles(parent_id);";

constexpr const char* kDeleteSQL = "DELETE FROM code_signing_info WHERE code_signing_id_text=?;";
constexpr const char* kInvalidateSQL =
    "UPDATE code_signing_info SET invalid=1 WHERE code_signing_id_text = ?;";
constexpr const char* kSelectEntrySQL =
    "SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
    "code_signing_info.registered_by_caller, code_signing_info.data_container_class FROM "
    "code_signing_info, code_signing_data WHERE code_signing_info.id = "
    "code_signing_data.cs_info_id "
    "AND code_signing_info.code_signing_id_text = ?;";
constexpr const char* kEnumerateSQL =
    "SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
    "code_signing_info.registered_by_caller, code_signing_info.data_container_class, "
    "code_signing_info.code_signing_id_text FROM code_signing_info, code_signing_data WHERE "
    "code_signing_info.id = code_signing_data.cs_info_id;";
constexpr const char* kIdentifiersSQL =
    "SELECT code_signing_info.code_signing_id_text FROM code_signing_info;";
constexpr const char* kChildrenSQL =
    "SELECT child_bundles.child_code_signing_id_text FROM child_bundles, code_signing_info WHERE "
    "code_signing_info.code_signing_id_text = ? AND child_bundles.parent_id=code_signing_info.id;";
constexpr const char* kParentSQL =
    "SELECT code_signing_info.code_signing_id_text FROM child_bundles, code_signing_info WHERE "
    "child_bundles.child_code_signing_id_text = ? AND "
    "child_bundles.parent_id=code_signing_info.id;";
constexpr const char* kDeleteAdvanceCopiesSQL =
    "DELETE FROM code_signing_info WHERE (placeholder & ?) > 0;";
constexpr const char* kUpdateInfoSQL =
    "UPDATE code_signing_info SET invalid=?, placeholder=?, registered_by_caller=?, "
    "data_container_class=? WHERE code_signing_id_text=?;";
constexpr const char* kInsertInfoSQL =
    "INSERT INTO code_signing_info (invalid, placeholder, registered_by_caller, "
    "data_container_class, code_signing_id_text) VALUES (?, ?, ?, ?, ?);";
constexpr const char* kInsertDataSQL =
    "INSERT OR REPLACE INTO code_signing_data (cs_info_id, data) SELECT id, ? FROM "
    "code_signing_info WHERE code_signing_id_text = ?;";
constexpr const char* kInsertChildSQL =
    "INSERT OR REPLACE INTO child_bundles (parent_id, child_code_signing_id_text) SELECT id, ? "
    "FROM code_signing_info WHERE code_signing_id_text = ?;";

constexpr int kPlaceholderBit = 1;
constexpr int kAdvanceCopyBit = 2;

// Logs to the daemon's log and to stderr, which under systemd is the journal,
// then aborts: for the failures after which the daemon cannot go on.
[[noreturn]] void crash(const char* function, const std::string& message) {
  QRVLog::write(QRVLogLevel::kError, function, message);
  std::string line = message + "\n";
  ssize_t ignored = ::write(STDERR_FILENO, line.data(), line.size());
  (void)ignored;
  abort();
}

const char* errorMessage(sqlite3* db) { return db ? sqlite3_errmsg(db) : "database is closed"; }

// Identifiers are byte strings of any length: the length is always passed
// (so NULs and invalid UTF-8 go through untouched and nothing stops at the
// first NUL), the 64-bit call lets SQLite refuse oversized text with
// SQLITE_TOOBIG instead of truncating a length, and an empty string is bound
// as "" rather than as the NULL an empty view's null pointer would give.
int bindText(sqlite3_stmt* statement, int index, std::string_view text) {
  return sqlite3_bind_text64(statement, index, text.data() ? text.data() : "", text.size(),
                             SQLITE_TRANSIENT, SQLITE_UTF8);
}

// Null when the column is NULL (or SQLite ran out of memory converting it).
std::optional<std::string_view> columnText(sqlite3_stmt* statement, int column) {
  const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(statement, column));
  if (!text) return std::nullopt;
  return std::string_view(text, static_cast<size_t>(sqlite3_column_bytes(statement, column)));
}

std::string_view orNull(std::optional<std::string_view> text) {
  return text ? *text : std::string_view("(null)");
}

// One prepared statement, finalized on every path. A finalize failure is
// only logged: by then the statement's result has been decided.
class Statement {
 public:
  Statement(sqlite3* db, const std::string& path) : db_(db), path_(path) {}
  ~Statement() {
    if (statement_ && sqlite3_finalize(statement_) != SQLITE_OK)
      QRVLogError("sqlite3_finalize for {} failed: {}", path_, errorMessage(db_));
  }
  Statement(const Statement&) = delete;
  Statement& operator=(const Statement&) = delete;

  bool prepare(const char* sql) {
    return db_ && sqlite3_prepare_v2(db_, sql, -1, &statement_, nullptr) == SQLITE_OK;
  }
  sqlite3_stmt* get() const { return statement_; }
  const char* errmsg() const { return errorMessage(db_); }

 private:
  sqlite3* const db_;
  const std::string& path_;
  sqlite3_stmt* statement_ = nullptr;
};

std::string describeException(std::exception_ptr exception) {
  try {
    std::rethrow_exception(exception);
  } catch (const std::exception& e) {
    int status = 0;
    char* name = abi::__cxa_demangle(typeid(e).name(), nullptr, nullptr, &status);
    std::string text = fmt::format("{}: {}", name ? name : typeid(e).name(), e.what());
    free(name);
    return text;
  } catch (...) {
    return "unknown exception";
  }
}

}  // namespace

sqlite3* QRVSQLiteDB::openDBWithURL(const std::filesystem::path& url) {
  QRVLogDebug("opening {}", url.native());
  sqlite3* db = nullptr;
  int rc = sqlite3_open_v2(url.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr);
  if (rc != SQLITE_OK) {
    QRVLogError("opening {} failed: {}", url.native(),
                db ? sqlite3_errmsg(db) : sqlite3_errstr(rc));
    sqlite3_close(db);
    crash(__func__, fmt::format("Failed to open database, err = {}", rc));
  }
  char* message = nullptr;
  rc = sqlite3_exec(db, kSchemaScript, nullptr, nullptr, &message);
  if (rc != SQLITE_OK) {
    QRVLogError("table create for {} failed: {}", url.native(),
                message ? message : sqlite3_errstr(rc));
    sqlite3_free(message);
    sqlite3_close(db);
    crash(__func__, fmt::format("Failed to initialize database, err = {}", rc));
  }
  return db;
}

std::unique_ptr<QRVSQLiteDB> QRVSQLiteDB::initWithParentDirectoryURL(
    const std::filesystem::path& directory, ExceptionReporter exceptionReporter) {
  if (directory.empty()) return nullptr;
  std::filesystem::path url = directory / "containers";
  url.replace_extension("sqlite3");
  sqlite3* db = openDBWithURL(url);
  if (!db) return nullptr;
  return std::unique_ptr<QRVSQLiteDB>(
      new QRVSQLiteDB(db, std::move(url), std::move(exceptionReporter)));
}

QRVSQLiteDB::QRVSQLiteDB(sqlite3* db, std::filesystem::path url,
                         ExceptionReporter exceptionReporter)
    : db_(db), url_(std::move(url)), exceptionReporter_(std::move(exceptionReporter)) {}

QRVSQLiteDB::~QRVSQLiteDB() { closeDB(); }

void QRVSQLiteDB::closeDB() {
  if (!db_) return;
  QRVLogDebug("closing {}", url_.native());
  int rc = sqlite3_close(db_);
  if (rc != SQLITE_OK) QRVLogError("sqlite3_close for {} failed: {}", url_.native(), rc);
  db_ = nullptr;
}

// MARK: - Building blocks

bool QRVSQLiteDB::_sqliteExec(const char* statement, QRVError* error) {
  if (!db_) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "{} on {} failed: {}", statement, url_.native(),
                                    errorMessage(db_)));
  }
  char* message = nullptr;
  if (sqlite3_exec(db_, statement, nullptr, nullptr, &message) == SQLITE_OK) return true;
  QRVError e = QRV_ERROR(QRVResultCode::kDatabaseFailed, "{} on {} failed: {}", statement, url_.native(),
                         message ? message : errorMessage(db_));
  sqlite3_free(message);
  return QRVFail(error, std::move(e));
}

bool QRVSQLiteDB::_performTwoParameterQuery(const char* sql, std::string_view textOne,
                                            std::optional<std::string_view> textTwo,
                                            int expectedChanges, QRVError* error) {
  const std::string& path = url_.native();
  Statement statement(db_, path);
  if (!statement.prepare(sql)) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(delete) for {} failed: {}", path,
                                    statement.errmsg()));
  }
  if (bindText(statement.get(), 1, textOne) != SQLITE_OK) {
    return QRVFail(error,
                   QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_bind_text for identifier={} at {} failed: {}",
                             textOne, path, statement.errmsg()));
  }
  if (textTwo && bindText(statement.get(), 2, *textTwo) != SQLITE_OK) {
    return QRVFail(error,
                   QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_bind_text for identifier={} at {} failed: {}",
                             *textTwo, path, statement.errmsg()));
  }
  if (sqlite3_step(statement.get()) != SQLITE_DONE) {
    return QRVFail(
        error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path, statement.errmsg()));
  }
  if (expectedChanges != -1) {
    int changes = sqlite3_changes(db_);
    // Quiet: the caller decides what a wrong count means and reports it.
    if (changes != expectedChanges) {
      return QRVFail(error, QRV_ERROR_QUIET(QRVResultCode::kDatabaseChangeCount,
                                            "sqlite3_changes for {} in {}: {}, but expecting {}", sql, path, changes,
                                            expectedChanges));
    }
  }
  return true;
}

bool QRVSQLiteDB::_performSingleParameterQuery(const char* sql, std::string_view text,
                                               int expectedChanges, QRVError* error) {
  return _performTwoParameterQuery(sql, text, std::nullopt, expectedChanges, error);
}

bool QRVSQLiteDB::_performSingleParameterQuery(const char* sql, std::string_view text,
                                               QRVError* error) {
  return _performSingleParameterQuery(sql, text, -1, error);
}

bool QRVSQLiteDB::_performInsertOrUpdateQuery(const char* sql, const QRVCodeSigningEntry& entry,
                                              std::string_view identifier, bool isUpdate,
                                              QRVError* error) {
  const std::string& path = url_.native();
  Statement statement(db_, path);
  if (!statement.prepare(sql)) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(insert) for {} failed: {}", path,
                                    statement.errmsg()));
  }
  sqlite3_stmt* s = statement.get();
  const int invalid = entry.isInvalid() ? 1 : 0;
  const int placeholder = entry.isPlaceholder() ? 1 : 0;
  const int advanceCopy = entry.isAdvanceCopy() ? 1 : 0;
  const int flags = (placeholder ? kPlaceholderBit : 0) | (advanceCopy ? kAdvanceCopyBit : 0);
  const int registeredByCaller = entry.isRegisteredByCaller() ? 1 : 0;
  const uint64_t dataContainerClass = entry.dataContainerClass();

  if (sqlite3_bind_int(s, 1, invalid) != SQLITE_OK) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_bind_int for invalid={} at {} failed: {}",
                                    invalid, path, statement.errmsg()));
  }
  if (sqlite3_bind_int(s, 2, flags) != SQLITE_OK) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed,
                                    "sqlite3_bind_int for placeholder={}, advance_copy={} "
                                    "(flags={}) at {} failed: {}",
                                    placeholder, advanceCopy, flags, path, statement.errmsg()));
  }
  if (sqlite3_bind_int(s, 3, registeredByCaller) != SQLITE_OK) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed,
                                    "sqlite3_bind_int for registered_by_caller={} at {} failed: {}", registeredByCaller,
                                    path, statement.errmsg()));
  }
  // The column has always held a 32-bit value; classes are small numbers.
  if (sqlite3_bind_int(s, 4, static_cast<int>(static_cast<uint32_t>(dataContainerClass))) !=
      SQLITE_OK) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed,
                                    "sqlite3_bind_int for data_container_class={} at {} failed: {}", dataContainerClass,
                                    path, statement.errmsg()));
  }
  if (bindText(s, 5, identifier) != SQLITE_OK) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed,
                                    "sqlite3_bind_text for code_signing_id_text={} at {} failed: {}", identifier, path,
                                    statement.errmsg()));
  }
  if (sqlite3_step(s) != SQLITE_DONE) {
    return QRVFail(
        error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path, statement.errmsg()));
  }
  if (isUpdate) {
    int changes = sqlite3_changes(db_);
    // Quiet: an update that finds no row is how a new identifier is told
    // apart from a known one, not a failure.
    if (changes != 1) {
      return QRVFail(error, QRV_ERROR_QUIET(QRVResultCode::kDatabaseChangeCount,
                                            "sqlite3_changes for {} in {}: {}, but expecting 1", sql, path, changes));
    }
  }
  return true;
}

bool QRVSQLiteDB::_insertCodeSigningInfo(const QRVCodeSigningEntry& entry,
                                         std::string_view identifier, QRVError* error) {
  // Updating first keeps the row's id, and with it the child rows that point
  // at it, when an identifier is registered again.
  QRVError updateError;
  if (_performInsertOrUpdateQuery(kUpdateInfoSQL, entry, identifier, true, &updateError))
    return true;
  if (updateError.domain() != QRVError::kDomain || updateError.code() != QRVResultCode::kDatabaseChangeCount) {
    return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kDatabaseFailed, updateError,
                                               "Error performing UPDATE operation for {}", identifier));
  }
  QRVError insertError;
  if (_performInsertOrUpdateQuery(kInsertInfoSQL, entry, identifier, false, &insertError))
    return true;
  return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kDatabaseFailed, insertError,
                                             "Error performing INSERT operation for {}", identifier));
}

bool QRVSQLiteDB::_insertCodeSigningData(const QRVCodeSigningEntry& entry,
                                         std::string_view identifier, QRVError* error) {
  QRVPlist::Bytes data;
  if (entry.hasCodeSigningInfo()) data = entry.codeSigningInfo().toBinary();
  if (data.empty()) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "Error creating KLData from code signing info: {}",
                                    entry.codeSigningInfo().description()));
  }
  const std::string& path = url_.native();
  Statement statement(db_, path);
  if (!statement.prepare(kInsertDataSQL)) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(insert) for {} failed: {}", path,
                                    statement.errmsg()));
  }
  // `data` outlives the step, so SQLite need not copy the blob.
  if (sqlite3_bind_blob64(statement.get(), 1, data.data(), data.size(), SQLITE_STATIC) !=
      SQLITE_OK) {
    return QRVFail(
        error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_bind_blob64 for codeSigningInfoData at {} failed: {}",
                         path, statement.errmsg()));
  }
  if (bindText(statement.get(), 2, identifier) != SQLITE_OK) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed,
                                    "sqlite3_bind_text for code_signing_id_text={} at {} failed: {}", identifier, path,
                                    statement.errmsg()));
  }
  if (sqlite3_step(statement.get()) != SQLITE_DONE) {
    return QRVFail(
        error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path, statement.errmsg()));
  }
  return true;
}

bool QRVSQLiteDB::_insertChildIdentifier(std::string_view child, std::string_view parent,
                                         QRVError* error) {
  const std::string& path = url_.native();
  QRVError cause;
  {
    Statement statement(db_, path);
    // The child column is unique, so OR REPLACE moves a child that another
    // parent claimed to this one.
    if (!statement.prepare(kInsertChildSQL)) {
      cause = QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(insert) for {} failed: {}", path,
                        statement.errmsg());
    } else if (bindText(statement.get(), 1, child) != SQLITE_OK) {
      cause = QRV_ERROR(QRVResultCode::kDatabaseFailed,
                        "sqlite3_bind_text for child_code_signing_id_text={} at {} failed: {}", child, path,
                        statement.errmsg());
    } else if (bindText(statement.get(), 2, parent) != SQLITE_OK) {
      cause =
          QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_bind_text for code_signing_id_text={} at {} failed: {}",
                    parent, path, statement.errmsg());
    } else if (sqlite3_step(statement.get()) != SQLITE_DONE) {
      cause = QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path, statement.errmsg());
    } else {
      return true;
    }
  }
  return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kDatabaseFailed, cause,
                                             "Error performing INSERT operation for child {}", child));
}

std::shared_ptr<QRVCodeSigningEntry> QRVSQLiteDB::_codeSigningEntryFromStatementRow(
    sqlite3_stmt* statement, QRVError* error) {
  // The property list is parsed straight from SQLite's buffer, which stays
  // valid until the statement is stepped again.
  const auto* bytes = static_cast<const uint8_t*>(sqlite3_column_blob(statement, 0));
  if (!bytes) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "Failed to create code signing entry from statement row"));
    return nullptr;
  }
  const auto length = static_cast<size_t>(sqlite3_column_bytes(statement, 0));
  try {
    std::optional<QRVPlist> info = QRVPlist::fromBytes(bytes, length);
    if (!info || !info->isDictionary()) {
      QRVError readError = info ? QRV_ERROR_QUIET(QRVResultCode::kInvalidFileContent,
                                                  "code-signing data is a property list but not a dictionary")
                                : QRV_ERROR_QUIET(QRVResultCode::kInvalidFileContent,
                                                  "code-signing data ({} bytes) is not a property list", length);
      QRVFail(error,
              QRV_ERROR_UNDERLYING(QRVResultCode::kDatabaseFailed, readError, "Error formatting info data from DB"));
      return nullptr;
    }
    const int flags = sqlite3_column_int(statement, 2);
    auto entry = std::make_shared<QRVCodeSigningEntry>(
        std::move(*info), static_cast<uint32_t>(sqlite3_column_int(statement, 4)));
    entry->setInvalid(sqlite3_column_int(statement, 1) != 0);
    entry->setPlaceholder((flags & kPlaceholderBit) != 0);
    entry->setAdvanceCopy((flags & kAdvanceCopyBit) != 0);
    entry->setRegisteredByCaller(sqlite3_column_int(statement, 3) != 0);
    return entry;
  } catch (const std::bad_alloc&) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kAllocationFailed, "Failed to allocate codeSigningEntry"));
    return nullptr;
  }
}

bool QRVSQLiteDB::_failInsideTransaction(std::exception_ptr exception, QRVError* error) {
  QRVError e = QRV_ERROR(QRVResultCode::kException, "exception inside a transaction on {}: {}", url_.native(),
                         describeException(exception));
  if (exceptionReporter_) exceptionReporter_(exception);
  QRVError rollbackError;
  if (!_sqliteExec("ROLLBACK;", &rollbackError))
    QRVLogError("rollback after exception failed: {}", rollbackError.description());
  return QRVFail(error, std::move(e));
}

// MARK: - Operations

bool QRVSQLiteDB::addCodeSigningEntry(const QRVCodeSigningEntry* entry,
                                      std::optional<std::string_view> identifier, QRVError* error) {
  if (!entry || !identifier) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput, "codeSigningEntry {} and identifier {} cannot be nil",
                                    entry ? entry->description() : "(null)", orNull(identifier)));
  }
  QRVError execError;
  if (!_sqliteExec("BEGIN;", &execError)) {
    return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kDatabaseFailed, execError, "failed _sqliteExec begin"));
  }
  try {
    QRVError writeError;
    if (!_insertCodeSigningInfo(*entry, *identifier, &writeError) ||
        !_insertCodeSigningData(*entry, *identifier, &writeError)) {
      QRVError rollbackError;
      if (!_sqliteExec("ROLLBACK;", &rollbackError)) {
        return QRVFail(
            error, QRV_ERROR_UNDERLYING(QRVResultCode::kDatabaseFailed, rollbackError, "failed _sqliteExec rollback"));
      }
      return QRVFail(error, std::move(writeError));
    }
    // A child that cannot be attached must not cost the parent its
    // registration; the failure is logged where it happens.
    if (const auto& children = entry->childBundleIdentifiers()) {
      for (const auto& child : *children) _insertChildIdentifier(child, *identifier, nullptr);
    }
    _runTestHook();
  } catch (...) {
    return _failInsideTransaction(std::current_exception(), error);
  }
  if (!_sqliteExec("COMMIT;", &execError)) {
    // Logged and dropped on purpose: callers have always been told that the
    // add succeeded once its statements ran, and they act on that.
    QRVError dropped = QRV_ERROR_UNDERLYING(QRVResultCode::kDatabaseFailed, execError, "failed _sqliteExec commit");
    (void)dropped;
    _endFailedCommit();
  }
  return true;
}

bool QRVSQLiteDB::deleteCodeSigningEntryWithIdentifier(std::optional<std::string_view> identifier,
                                                       QRVError* error) {
  if (!identifier) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput, "\bidentifier {} cannot be nil", "(null)"));
  }
  QRVError queryError;
  if (!_performSingleParameterQuery(kDeleteSQL, *identifier, 1, &queryError)) {
    return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kDatabaseFailed, queryError,
                                               "failed to delete from code_signing_info"));
  }
  return true;
}

std::shared_ptr<const QRVCodeSigningEntry> QRVSQLiteDB::codeSigningEntryWithIdentifier(
    std::string_view identifier, QRVError* error) {
  const std::string& path = url_.native();
  std::shared_ptr<QRVCodeSigningEntry> entry;
  {
    Statement statement(db_, path);
    if (!statement.prepare(kSelectEntrySQL)) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(select) for {} failed: {}", path,
                               statement.errmsg()));
      return nullptr;
    }
    if (bindText(statement.get(), 1, identifier) != SQLITE_OK) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_bind_text for identifier={} at {} failed: {}",
                               identifier, path, statement.errmsg()));
      return nullptr;
    }
    int rc = sqlite3_step(statement.get());
    if (rc == SQLITE_DONE) {
      QRVFail(error,
              QRV_ERROR_QUIET(QRVResultCode::kDatabaseNotFound, "Identifier: \"{}\" Not Found in DB", identifier));
      return nullptr;
    }
    if (rc != SQLITE_ROW) {
      QRVFail(error,
              QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path, statement.errmsg()));
      return nullptr;
    }
    entry = _codeSigningEntryFromStatementRow(statement.get(), error);
    if (!entry) return nullptr;
  }
  QRVError childError;
  if (auto children = childIdentifiersForParentIdentifier(identifier, &childError)) {
    entry->setChildBundleIdentifiers(std::move(children));
  } else if (childError.code() != QRVResultCode::kDatabaseNotFound) {
    QRVLogError("Error retrieving childBundleIds: {}", childError.description());
    QRVFail(error, std::move(childError));
    return nullptr;
  }
  return entry;
}

bool QRVSQLiteDB::invalidateCodeSigningWithIdentifier(std::string_view identifier,
                                                      QRVError* error) {
  QRVError queryError;
  if (!_performSingleParameterQuery(kInvalidateSQL, identifier, &queryError)) {
    return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kDatabaseFailed, queryError,
                                               "failed to invalidate identifier {}", identifier));
  }
  return true;
}

bool QRVSQLiteDB::invalidateCodeSigningForIdentifierAndAllChildren(std::string_view identifier,
                                                                   QRVError* error) {
  std::vector<std::string> identifiers{std::string(identifier)};
  QRVError childError;
  if (auto children = childIdentifiersForParentIdentifier(identifier, &childError)) {
    identifiers.insert(identifiers.end(), children->begin(), children->end());
  } else if (childError.code() != QRVResultCode::kDatabaseNotFound) {
    return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kDatabaseFailed, childError,
                                               "failed to invalidate identifier {}", identifier));
  }

  QRVError execError;
  if (!_sqliteExec("BEGIN;", &execError)) {
    return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kDatabaseFailed, execError, "failed _sqliteExec begin"));
  }
  try {
    for (const auto& member : identifiers) {
      QRVError invalidateError;
      if (invalidateCodeSigningWithIdentifier(member, &invalidateError)) {
        QRVLogDebug("Invalidating code signing info for {} child: {}", identifier, member);
      } else {
        QRVLogError("Failed to invalidate code signing info for {} child {} : {}", identifier,
                    member, invalidateError.description());
      }
    }
    _runTestHook();
  } catch (...) {
    return _failInsideTransaction(std::current_exception(), error);
  }
  if (!_sqliteExec("COMMIT;", &execError)) {
    _endFailedCommit();
    return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kDatabaseFailed, execError, "failed _sqliteExec commit"));
  }
  return true;
}

void QRVSQLiteDB::_endFailedCommit() {
  // A COMMIT that fails may leave its transaction open, and then every later
  // BEGIN of this connection would fail for the rest of the daemon's life.
  if (db_ && sqlite3_get_autocommit(db_) == 0) {
    QRVError rollbackError;
    if (!_sqliteExec("ROLLBACK;", &rollbackError))
      QRVLogError("rollback after a failed commit failed: {}", rollbackError.description());
  }
}

std::optional<QRVError> QRVSQLiteDB::enumerateIdentifiersAndCodeSigningInfoUsingBlock(
    const EnumerationBlock& block) {
  const std::string& path = url_.native();
  Statement statement(db_, path);
  if (!statement.prepare(kEnumerateSQL)) {
    return QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(select) for {} failed: {}", path,
                     statement.errmsg());
  }
  for (;;) {
    int rc = sqlite3_step(statement.get());
    if (rc == SQLITE_DONE) return std::nullopt;
    if (rc != SQLITE_ROW) {
      return QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path, statement.errmsg());
    }
    // Everything made for a row lives in this scope, so the walk holds one
    // row's objects at a time however large the table grows.
    std::shared_ptr<QRVCodeSigningEntry> entry =
        _codeSigningEntryFromStatementRow(statement.get(), nullptr);
    if (!entry) continue;  // logged where it failed
    std::optional<std::string_view> text = columnText(statement.get(), 5);
    std::string identifier;
    try {
      if (!text) throw std::bad_alloc();
      identifier.assign(*text);
    } catch (const std::bad_alloc&) {
      return QRV_ERROR(QRVResultCode::kAllocationFailed, "Failed to allocate identifier for text: {}", orNull(text));
    }
    QRVError childError;
    if (auto children = childIdentifiersForParentIdentifier(identifier, &childError)) {
      entry->setChildBundleIdentifiers(std::move(children));
    } else if (childError.code() != QRVResultCode::kDatabaseNotFound) {
      QRVLogError("Error retrieving childBundleIds: {}", childError.description());
      continue;
    }
    block(identifier, entry);
  }
}

std::optional<std::vector<std::string>> QRVSQLiteDB::identifiersWithError(QRVError* error) {
  const std::string& path = url_.native();
  Statement statement(db_, path);
  if (!statement.prepare(kIdentifiersSQL)) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(select) for {} failed: {}", path,
                             statement.errmsg()));
    return std::nullopt;
  }
  std::vector<std::string> identifiers;
  for (;;) {
    int rc = sqlite3_step(statement.get());
    if (rc == SQLITE_DONE) return identifiers;
    if (rc != SQLITE_ROW) {
      QRVFail(error,
              QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path, statement.errmsg()));
      return std::nullopt;
    }
    std::optional<std::string_view> text = columnText(statement.get(), 0);
    try {
      if (!text) throw std::bad_alloc();
      identifiers.emplace_back(*text);
    } catch (const std::bad_alloc&) {
      QRVFail(error,
              QRV_ERROR(QRVResultCode::kAllocationFailed, "Failed to allocate identifier for text: {}", orNull(text)));
      return std::nullopt;
    }
  }
}

std::optional<std::vector<std::string>> QRVSQLiteDB::childIdentifiersForParentIdentifier(
    std::string_view parentIdentifier, QRVError* error) {
  const std::string& path = url_.native();
  Statement statement(db_, path);
  if (!statement.prepare(kChildrenSQL)) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(select) for {} failed: {}", path,
                             statement.errmsg()));
    return std::nullopt;
  }
  if (bindText(statement.get(), 1, parentIdentifier) != SQLITE_OK) {
    QRVFail(error,
            QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_bind_text for code_signing_id={} at {} failed: {}",
                      parentIdentifier, path, statement.errmsg()));
    return std::nullopt;
  }
  std::vector<std::string> children;
  try {
    children.reserve(4);
  } catch (const std::bad_alloc&) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kAllocationFailed, "Failed to allocate childBundleIds"));
    return std::nullopt;
  }
  for (;;) {
    int rc = sqlite3_step(statement.get());
    if (rc == SQLITE_DONE) break;
    if (rc != SQLITE_ROW) {
      QRVFail(error,
              QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path, statement.errmsg()));
      return std::nullopt;
    }
    std::optional<std::string_view> text = columnText(statement.get(), 0);
    try {
      if (!text) throw std::bad_alloc();
      children.emplace_back(*text);
    } catch (const std::bad_alloc&) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kAllocationFailed, "Failed to allocate thisChildBundleId for text: {}",
                               orNull(text)));
      return std::nullopt;
    }
  }
  if (children.empty()) {
    QRVFail(error, QRV_ERROR_QUIET(QRVResultCode::kDatabaseNotFound,
                                   "Children for parent identifier: \"{}\" Not Found in DB", parentIdentifier));
    return std::nullopt;
  }
  return children;
}

std::optional<std::string> QRVSQLiteDB::parentIdentifierForChildIdentifier(
    std::string_view childIdentifier, QRVError* error) {
  const std::string& path = url_.native();
  Statement statement(db_, path);
  if (!statement.prepare(kParentSQL)) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(select) for {} failed: {}", path,
                             statement.errmsg()));
    return std::nullopt;
  }
  if (bindText(statement.get(), 1, childIdentifier) != SQLITE_OK) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed,
                             "sqlite3_bind_text for child_code_signing_id_text={} at {} "
                             "failed: {}",
                             childIdentifier, path, statement.errmsg()));
    return std::nullopt;
  }
  int rc = sqlite3_step(statement.get());
  if (rc == SQLITE_DONE) {
    QRVFail(error, QRV_ERROR_QUIET(QRVResultCode::kDatabaseNotFound, "Parent identifier for: \"{}\" Not Found in DB",
                                   childIdentifier));
    return std::nullopt;
  }
  if (rc != SQLITE_ROW) {
    QRVFail(error,
            QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path, statement.errmsg()));
    return std::nullopt;
  }
  std::optional<std::string_view> text = columnText(statement.get(), 0);
  try {
    if (!text) throw std::bad_alloc();
    return std::string(*text);
  } catch (const std::bad_alloc&) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kAllocationFailed, "Failed to allocate parentIdentifier for text: {}",
                             orNull(text)));
    return std::nullopt;
  }
}

bool QRVSQLiteDB::deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(QRVError* error) {
  const std::string& path = url_.native();
  Statement statement(db_, path);
  if (!statement.prepare(kDeleteAdvanceCopiesSQL)) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(delete) for {} failed: {}", path,
                                    statement.errmsg()));
  }
  if (sqlite3_bind_int(statement.get(), 1, kAdvanceCopyBit) != SQLITE_OK) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_bind_text for flags={} at {} failed: {}",
                                    kAdvanceCopyBit, path, statement.errmsg()));
  }
  if (sqlite3_step(statement.get()) != SQLITE_DONE) {
    return QRVFail(
        error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path, statement.errmsg()));
  }
  QRVLogNotice("Deleted {} advance copies of code signing info.", sqlite3_changes(db_));
  return true;
}

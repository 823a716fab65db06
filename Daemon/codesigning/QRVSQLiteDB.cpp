#include "codesigning/QRVSQLiteDB.h"

#include <cxxabi.h>
#include <sqlite3.h>

#include <atomic>
#include <cstdlib>
#include <new>
#include <typeinfo>
#include <utility>

#include "base/QRVLog.h"
#include "base/QRVResultCode.h"
#include "codesigning/QRVSQLiteSchema.h"
#include "codesigning/QRVSQLiteStatement.h"

using namespace QRVSQLiteSchema;
using Step = QRVSQLiteStatement::Step;

namespace {

const char* errorMessage(sqlite3* db) { return db ? sqlite3_errmsg(db) : "database is closed"; }

std::string_view orNull(std::optional<std::string_view> text) { return text ? *text : std::string_view("(null)"); }

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

std::atomic<uint64_t> gChangeCount{0};

// Counts a change when the write it guards has finished, committed or not:
// whoever read the count before the write and the database after it looks
// again at the next count.
struct CountsChange {
  ~CountsChange() { gChangeCount++; }
};

}  // namespace

uint64_t QRVSQLiteDB::changeCount() { return gChangeCount.load(); }

sqlite3* QRVSQLiteDB::openDBWithURL(const std::filesystem::path& url) { return QRVSQLiteSchema::openDBWithURL(url); }

sqlite3* QRVSQLiteDB::tryOpenDBWithURL(const std::filesystem::path& url, QRVError* error) {
  return QRVSQLiteSchema::tryOpenDBWithURL(url, error);
}

std::unique_ptr<QRVSQLiteDB> QRVSQLiteDB::tryInitWithParentDirectoryURL(const std::filesystem::path& directory,
                                                                        QRVError* error,
                                                                        ExceptionReporter exceptionReporter) {
  if (directory.empty()) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput, "database directory cannot be empty"));
    return nullptr;
  }
  std::filesystem::path url = directory / "containers";
  url.replace_extension("sqlite3");
  sqlite3* db = tryOpenDBWithURL(url, error);
  if (!db) return nullptr;
  return std::unique_ptr<QRVSQLiteDB>(new QRVSQLiteDB(db, std::move(url), std::move(exceptionReporter)));
}

std::unique_ptr<QRVSQLiteDB> QRVSQLiteDB::initWithParentDirectoryURL(const std::filesystem::path& directory,
                                                                     ExceptionReporter exceptionReporter) {
  if (directory.empty()) return nullptr;
  std::filesystem::path url = directory / "containers";
  url.replace_extension("sqlite3");
  sqlite3* db = openDBWithURL(url);
  if (!db) return nullptr;
  return std::unique_ptr<QRVSQLiteDB>(new QRVSQLiteDB(db, std::move(url), std::move(exceptionReporter)));
}

QRVSQLiteDB::QRVSQLiteDB(sqlite3* db, std::filesystem::path url, ExceptionReporter exceptionReporter)
    : db_(db), url_(std::move(url)), exceptionReporter_(std::move(exceptionReporter)) {
  gChangeCount++;
}

QRVSQLiteDB::~QRVSQLiteDB() { closeDB(); }

void QRVSQLiteDB::closeDB() {
  if (!db_) return;
  CountsChange counted;
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
                                            std::optional<std::string_view> textTwo, int expectedChanges,
                                            QRVError* error) {
  const std::string& path = url_.native();
  QRVSQLiteStatement statement(db_, sql, path);
  if (!statement.prepared()) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(delete) for {} failed: {}", path,
                                    statement.errorMessage()));
  }
  if (!statement.bindText(1, textOne)) {
    return QRVFail(error,
                   QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_bind_text for identifier={} at {} failed: {}",
                             textOne, path, statement.errorMessage()));
  }
  if (textTwo && !statement.bindText(2, *textTwo)) {
    return QRVFail(error,
                   QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_bind_text for identifier={} at {} failed: {}",
                             *textTwo, path, statement.errorMessage()));
  }
  if (statement.step() != Step::kDone) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path,
                                    statement.errorMessage()));
  }
  if (expectedChanges != -1) {
    int changes = statement.changes();
    // Quiet: the caller decides what a wrong count means and reports it.
    if (changes != expectedChanges) {
      return QRVFail(error, QRV_ERROR_QUIET(QRVResultCode::kDatabaseChangeCount,
                                            "sqlite3_changes for {} in {}: {}, but expecting {}", sql, path, changes,
                                            expectedChanges));
    }
  }
  return true;
}

bool QRVSQLiteDB::_performSingleParameterQuery(const char* sql, std::string_view text, int expectedChanges,
                                               QRVError* error) {
  return _performTwoParameterQuery(sql, text, std::nullopt, expectedChanges, error);
}

bool QRVSQLiteDB::_performSingleParameterQuery(const char* sql, std::string_view text, QRVError* error) {
  return _performSingleParameterQuery(sql, text, -1, error);
}

bool QRVSQLiteDB::_performInsertOrUpdateQuery(const char* sql, const QRVCodeSigningEntry& entry,
                                              std::string_view identifier, bool isUpdate, QRVError* error) {
  const std::string& path = url_.native();
  QRVSQLiteStatement statement(db_, sql, path);
  if (!statement.prepared()) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(insert) for {} failed: {}", path,
                                    statement.errorMessage()));
  }
  const int invalid = entry.isInvalid() ? 1 : 0;
  const int placeholder = entry.isPlaceholder() ? 1 : 0;
  const int advanceCopy = entry.isAdvanceCopy() ? 1 : 0;
  const int flags = (placeholder ? kPlaceholderBit : 0) | (advanceCopy ? kAdvanceCopyBit : 0);
  const int registeredByCaller = entry.isRegisteredByCaller() ? 1 : 0;
  const uint64_t dataContainerClass = entry.dataContainerClass();

  if (!statement.bindInt(1, invalid)) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_bind_int for invalid={} at {} failed: {}",
                                    invalid, path, statement.errorMessage()));
  }
  if (!statement.bindInt(2, flags)) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed,
                                    "sqlite3_bind_int for placeholder={}, advance_copy={} "
                                    "(flags={}) at {} failed: {}",
                                    placeholder, advanceCopy, flags, path, statement.errorMessage()));
  }
  if (!statement.bindInt(3, registeredByCaller)) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed,
                                    "sqlite3_bind_int for registered_by_caller={} at {} failed: {}", registeredByCaller,
                                    path, statement.errorMessage()));
  }
  // The column has always held a 32-bit value; classes are small numbers.
  if (!statement.bindInt(4, static_cast<int>(static_cast<uint32_t>(dataContainerClass)))) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed,
                                    "sqlite3_bind_int for data_container_class={} at {} failed: {}", dataContainerClass,
                                    path, statement.errorMessage()));
  }
  if (!statement.bindText(5, identifier)) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed,
                                    "sqlite3_bind_text for code_signing_id_text={} at {} failed: {}", identifier, path,
                                    statement.errorMessage()));
  }
  if (statement.step() != Step::kDone) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path,
                                    statement.errorMessage()));
  }
  if (isUpdate) {
    int changes = statement.changes();
    // Quiet: an update that finds no row is how a new identifier is told
    // apart from a known one, not a failure.
    if (changes != 1) {
      return QRVFail(error, QRV_ERROR_QUIET(QRVResultCode::kDatabaseChangeCount,
                                            "sqlite3_changes for {} in {}: {}, but expecting 1", sql, path, changes));
    }
  }
  return true;
}

bool QRVSQLiteDB::_insertCodeSigningInfo(const QRVCodeSigningEntry& entry, std::string_view identifier,
                                         QRVError* error) {
  // Updating first keeps the row's id, and with it the child rows that point
  // at it, when an identifier is registered again.
  QRVError updateError;
  if (_performInsertOrUpdateQuery(kUpdateInfoSQL, entry, identifier, true, &updateError)) return true;
  if (updateError.domain() != QRVError::kDomain || updateError.code() != QRVResultCode::kDatabaseChangeCount) {
    return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kDatabaseFailed, updateError,
                                               "Error performing UPDATE operation for {}", identifier));
  }
  QRVError insertError;
  if (_performInsertOrUpdateQuery(kInsertInfoSQL, entry, identifier, false, &insertError)) return true;
  return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kDatabaseFailed, insertError,
                                             "Error performing INSERT operation for {}", identifier));
}

bool QRVSQLiteDB::_insertCodeSigningData(const QRVCodeSigningEntry& entry, std::string_view identifier,
                                         QRVError* error) {
  QRVPlist::Bytes data;
  if (entry.hasCodeSigningInfo()) data = entry.codeSigningInfo().toBinary();
  if (data.empty()) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "Error creating KLData from code signing info: {}",
                                    entry.codeSigningInfo().description()));
  }
  const std::string& path = url_.native();
  QRVSQLiteStatement statement(db_, kInsertDataSQL, path);
  if (!statement.prepared()) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(insert) for {} failed: {}", path,
                                    statement.errorMessage()));
  }
  // `data` outlives the step, so SQLite need not copy the blob.
  if (!statement.bindBlob(1, data.data(), data.size())) {
    return QRVFail(
        error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_bind_blob64 for codeSigningInfoData at {} failed: {}",
                         path, statement.errorMessage()));
  }
  if (!statement.bindText(2, identifier)) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed,
                                    "sqlite3_bind_text for code_signing_id_text={} at {} failed: {}", identifier, path,
                                    statement.errorMessage()));
  }
  if (statement.step() != Step::kDone) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path,
                                    statement.errorMessage()));
  }
  return true;
}

bool QRVSQLiteDB::_insertChildIdentifier(std::string_view child, std::string_view parent, QRVError* error) {
  const std::string& path = url_.native();
  QRVError cause;
  {
    // The child column is unique, so OR REPLACE moves a child that another
    // parent claimed to this one.
    QRVSQLiteStatement statement(db_, kInsertChildSQL, path);
    if (!statement.prepared()) {
      cause = QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(insert) for {} failed: {}", path,
                        statement.errorMessage());
    } else if (!statement.bindText(1, child)) {
      cause = QRV_ERROR(QRVResultCode::kDatabaseFailed,
                        "sqlite3_bind_text for child_code_signing_id_text={} at {} failed: {}", child, path,
                        statement.errorMessage());
    } else if (!statement.bindText(2, parent)) {
      cause =
          QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_bind_text for code_signing_id_text={} at {} failed: {}",
                    parent, path, statement.errorMessage());
    } else if (statement.step() != Step::kDone) {
      cause =
          QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path, statement.errorMessage());
    } else {
      return true;
    }
  }
  return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kDatabaseFailed, cause,
                                             "Error performing INSERT operation for child {}", child));
}

std::shared_ptr<QRVCodeSigningEntry> QRVSQLiteDB::_codeSigningEntryFromStatementRow(const QRVSQLiteStatement& statement,
                                                                                    QRVError* error) {
  // The property list is parsed straight from SQLite's buffer, which stays
  // valid until the statement is stepped again.
  size_t length = 0;
  const uint8_t* bytes = statement.columnBlob(0, &length);
  if (!bytes) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "Failed to create code signing entry from statement row"));
    return nullptr;
  }
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
    const int flags = statement.columnInt(2);
    auto entry = std::make_shared<QRVCodeSigningEntry>(std::move(*info), static_cast<uint32_t>(statement.columnInt(4)));
    entry->setInvalid(statement.columnInt(1) != 0);
    entry->setPlaceholder((flags & kPlaceholderBit) != 0);
    entry->setAdvanceCopy((flags & kAdvanceCopyBit) != 0);
    entry->setRegisteredByCaller(statement.columnInt(3) != 0);
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

bool QRVSQLiteDB::addCodeSigningEntry(const QRVCodeSigningEntry* entry, std::optional<std::string_view> identifier,
                                      QRVError* error) {
  CountsChange counted;
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

bool QRVSQLiteDB::deleteCodeSigningEntryWithIdentifier(std::optional<std::string_view> identifier, QRVError* error) {
  CountsChange counted;
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

std::shared_ptr<const QRVCodeSigningEntry> QRVSQLiteDB::codeSigningEntryWithIdentifier(std::string_view identifier,
                                                                                       QRVError* error) {
  const std::string& path = url_.native();
  std::shared_ptr<QRVCodeSigningEntry> entry;
  {
    QRVSQLiteStatement statement(db_, kSelectEntrySQL, path);
    if (!statement.prepared()) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(select) for {} failed: {}", path,
                               statement.errorMessage()));
      return nullptr;
    }
    if (!statement.bindText(1, identifier)) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_bind_text for identifier={} at {} failed: {}",
                               identifier, path, statement.errorMessage()));
      return nullptr;
    }
    Step step = statement.step();
    if (step == Step::kDone) {
      QRVFail(error,
              QRV_ERROR_QUIET(QRVResultCode::kDatabaseNotFound, "Identifier: \"{}\" Not Found in DB", identifier));
      return nullptr;
    }
    if (step != Step::kRow) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path,
                               statement.errorMessage()));
      return nullptr;
    }
    entry = _codeSigningEntryFromStatementRow(statement, error);
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

bool QRVSQLiteDB::invalidateCodeSigningWithIdentifier(std::string_view identifier, QRVError* error) {
  CountsChange counted;
  QRVError queryError;
  if (!_performSingleParameterQuery(kInvalidateSQL, identifier, &queryError)) {
    return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kDatabaseFailed, queryError,
                                               "failed to invalidate identifier {}", identifier));
  }
  return true;
}

bool QRVSQLiteDB::invalidateCodeSigningForIdentifierAndAllChildren(std::string_view identifier, QRVError* error) {
  CountsChange counted;
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
        QRVLogError("Failed to invalidate code signing info for {} child {} : {}", identifier, member,
                    invalidateError.description());
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

std::optional<QRVError> QRVSQLiteDB::enumerateIdentifiersAndCodeSigningInfoUsingBlock(const EnumerationBlock& block) {
  const std::string& path = url_.native();
  QRVSQLiteStatement statement(db_, kEnumerateSQL, path);
  if (!statement.prepared()) {
    return QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(select) for {} failed: {}", path,
                     statement.errorMessage());
  }
  for (;;) {
    Step step = statement.step();
    if (step == Step::kDone) return std::nullopt;
    if (step != Step::kRow) {
      return QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path,
                       statement.errorMessage());
    }
    // Everything made for a row lives in this scope, so the walk holds one
    // row's objects at a time however large the table grows.
    std::shared_ptr<QRVCodeSigningEntry> entry = _codeSigningEntryFromStatementRow(statement, nullptr);
    if (!entry) continue;  // logged where it failed
    std::optional<std::string_view> text = statement.columnText(5);
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
  QRVSQLiteStatement statement(db_, kIdentifiersSQL, path);
  if (!statement.prepared()) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(select) for {} failed: {}", path,
                             statement.errorMessage()));
    return std::nullopt;
  }
  std::vector<std::string> identifiers;
  for (;;) {
    Step step = statement.step();
    if (step == Step::kDone) return identifiers;
    if (step != Step::kRow) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path,
                               statement.errorMessage()));
      return std::nullopt;
    }
    std::optional<std::string_view> text = statement.columnText(0);
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
  QRVSQLiteStatement statement(db_, kChildrenSQL, path);
  if (!statement.prepared()) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(select) for {} failed: {}", path,
                             statement.errorMessage()));
    return std::nullopt;
  }
  if (!statement.bindText(1, parentIdentifier)) {
    QRVFail(error,
            QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_bind_text for code_signing_id={} at {} failed: {}",
                      parentIdentifier, path, statement.errorMessage()));
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
    Step step = statement.step();
    if (step == Step::kDone) break;
    if (step != Step::kRow) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path,
                               statement.errorMessage()));
      return std::nullopt;
    }
    std::optional<std::string_view> text = statement.columnText(0);
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

std::optional<std::string> QRVSQLiteDB::parentIdentifierForChildIdentifier(std::string_view childIdentifier,
                                                                           QRVError* error) {
  const std::string& path = url_.native();
  QRVSQLiteStatement statement(db_, kParentSQL, path);
  if (!statement.prepared()) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(select) for {} failed: {}", path,
                             statement.errorMessage()));
    return std::nullopt;
  }
  if (!statement.bindText(1, childIdentifier)) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed,
                             "sqlite3_bind_text for child_code_signing_id_text={} at {} "
                             "failed: {}",
                             childIdentifier, path, statement.errorMessage()));
    return std::nullopt;
  }
  Step step = statement.step();
  if (step == Step::kDone) {
    QRVFail(error, QRV_ERROR_QUIET(QRVResultCode::kDatabaseNotFound, "Parent identifier for: \"{}\" Not Found in DB",
                                   childIdentifier));
    return std::nullopt;
  }
  if (step != Step::kRow) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path,
                             statement.errorMessage()));
    return std::nullopt;
  }
  std::optional<std::string_view> text = statement.columnText(0);
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
  CountsChange counted;
  const std::string& path = url_.native();
  QRVSQLiteStatement statement(db_, kDeleteAdvanceCopiesSQL, path);
  if (!statement.prepared()) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_prepare(delete) for {} failed: {}", path,
                                    statement.errorMessage()));
  }
  if (!statement.bindInt(1, kAdvanceCopyBit)) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_bind_text for flags={} at {} failed: {}",
                                    kAdvanceCopyBit, path, statement.errorMessage()));
  }
  if (statement.step() != Step::kDone) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "sqlite3_step for {} failed: {}", path,
                                    statement.errorMessage()));
  }
  QRVLogNotice("Deleted {} advance copies of code signing info.", statement.changes());
  return true;
}

#include "codesigning/QRVSQLiteStatement.h"

#include <sqlite3.h>

#include "base/QRVLog.h"

QRVSQLiteStatement::QRVSQLiteStatement(sqlite3* db, const char* sql, const std::string& path) : db_(db), path_(path) {
  // SQLite leaves the handle null when preparing fails.
  if (db_ && sqlite3_prepare_v2(db_, sql, -1, &statement_, nullptr) != SQLITE_OK) {
    sqlite3_finalize(statement_);
    statement_ = nullptr;
  }
}

QRVSQLiteStatement::~QRVSQLiteStatement() {
  if (statement_ && sqlite3_finalize(statement_) != SQLITE_OK)
    QRVLogError("sqlite3_finalize for {} failed: {}", path_, errorMessage());
}

const char* QRVSQLiteStatement::errorMessage() const { return db_ ? sqlite3_errmsg(db_) : "database is closed"; }

bool QRVSQLiteStatement::bindText(int index, std::string_view text) {
  return sqlite3_bind_text64(statement_, index, text.data() ? text.data() : "", text.size(), SQLITE_TRANSIENT,
                             SQLITE_UTF8) == SQLITE_OK;
}

bool QRVSQLiteStatement::bindInt(int index, int value) {
  return sqlite3_bind_int(statement_, index, value) == SQLITE_OK;
}

bool QRVSQLiteStatement::bindBlob(int index, const void* data, size_t size) {
  return sqlite3_bind_blob64(statement_, index, data, size, SQLITE_STATIC) == SQLITE_OK;
}

QRVSQLiteStatement::Step QRVSQLiteStatement::step() {
  switch (sqlite3_step(statement_)) {
    case SQLITE_ROW:
      return Step::kRow;
    case SQLITE_DONE:
      return Step::kDone;
    default:
      return Step::kError;
  }
}

int QRVSQLiteStatement::columnInt(int column) const { return sqlite3_column_int(statement_, column); }

std::optional<std::string_view> QRVSQLiteStatement::columnText(int column) const {
  const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(statement_, column));
  if (!text) return std::nullopt;
  return std::string_view(text, static_cast<size_t>(sqlite3_column_bytes(statement_, column)));
}

const uint8_t* QRVSQLiteStatement::columnBlob(int column, size_t* length) const {
  // The blob first, then its size: asking for the size first may convert
  // the value and move the buffer.
  const auto* bytes = static_cast<const uint8_t*>(sqlite3_column_blob(statement_, column));
  *length = static_cast<size_t>(sqlite3_column_bytes(statement_, column));
  return bytes;
}

int QRVSQLiteStatement::changes() const { return sqlite3_changes(db_); }

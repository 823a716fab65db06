// One prepared SQLite statement, finalized when it goes out of scope, so no
// path through the code-signing database can leak one or finalize twice.
//
// Check `prepared()` before anything else; when it is false (the SQL did not
// compile, or the connection is closed) `errorMessage()` says why. Binds and
// steps report SQLite's verdict, and `errorMessage()` is the connection's
// message for the last failure. Not thread-safe, like the connection.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

struct sqlite3;
struct sqlite3_stmt;

class QRVSQLiteStatement {
 public:
  enum class Step { kRow, kDone, kError };

  // `path` names the database in the log line of a failed finalize; it must
  // outlive the statement.
  QRVSQLiteStatement(sqlite3* db, const char* sql, const std::string& path);
  // A finalize failure is only logged: by then the statement's result has
  // been decided.
  ~QRVSQLiteStatement();
  QRVSQLiteStatement(const QRVSQLiteStatement&) = delete;
  QRVSQLiteStatement& operator=(const QRVSQLiteStatement&) = delete;

  bool prepared() const { return statement_ != nullptr; }
  // The connection's latest error, or "database is closed" without one.
  const char* errorMessage() const;

  // Parameters count from 1. Each returns true on success.
  //
  // Text is a byte string of any length: the length is always passed (so
  // NULs and invalid UTF-8 go through untouched), the 64-bit call lets SQLite
  // refuse oversized text instead of truncating a length, and an empty
  // string is bound as "" rather than as NULL. SQLite keeps its own copy.
  bool bindText(int index, std::string_view text);
  bool bindInt(int index, int value);
  // Not copied: `data` must stay valid until the last step.
  bool bindBlob(int index, const void* data, size_t size);

  Step step();

  // Columns of the current row, counted from 0. Text and blob point into
  // SQLite's buffer, valid until the next step.
  int columnInt(int column) const;
  // None when the column is NULL (or SQLite ran out of memory converting it).
  std::optional<std::string_view> columnText(int column) const;
  // Null for a NULL or empty blob; `length` receives its size.
  const uint8_t* columnBlob(int column, size_t* length) const;

  // Rows changed by the connection's latest INSERT, UPDATE or DELETE.
  int changes() const;

 private:
  sqlite3* const db_;
  const std::string& path_;
  sqlite3_stmt* statement_ = nullptr;
};

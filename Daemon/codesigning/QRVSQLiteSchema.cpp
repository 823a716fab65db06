#include "codesigning/QRVSQLiteSchema.h"

#include <sqlite3.h>
#include <unistd.h>

#include <cstdlib>

#include "base/QRVLog.h"
#include "base/QRVResultCode.h"

namespace {

// Logs to the daemon's log and to stderr, which under systemd is the journal,
// then aborts: for the failures after which the daemon cannot go on.
[[noreturn]] void crash(const char* function, const std::string& message) {
  QRVLog::write(QRVLogLevel::kError, function, message);
  std::string line = message + "\n";
  ssize_t ignored = ::write(STDERR_FILENO, line.data(), line.size());
  (void)ignored;
  abort();
}

}  // namespace

namespace QRVSQLiteSchema {

sqlite3* tryOpenDBWithURL(const std::filesystem::path& url, QRVError* error, OpenFailure* failure, int* sqliteResult) {
  auto fail = [&](OpenFailure step, int rc, QRVError e) -> sqlite3* {
    if (failure) *failure = step;
    if (sqliteResult) *sqliteResult = rc;
    QRVFail(error, std::move(e));
    return nullptr;
  };
  if (failure) *failure = OpenFailure::kNone;
  QRVLogDebug("opening {}", url.native());
  sqlite3* db = nullptr;
  int rc = sqlite3_open_v2(url.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr);
  if (rc != SQLITE_OK) {
    QRVError e = QRV_ERROR(QRVResultCode::kDatabaseFailed, "opening {} failed: {}", url.native(),
                           db ? sqlite3_errmsg(db) : sqlite3_errstr(rc));
    sqlite3_close(db);
    return fail(OpenFailure::kOpen, rc, std::move(e));
  }
  char* message = nullptr;
  rc = sqlite3_exec(db, kSchemaScript, nullptr, nullptr, &message);
  if (rc != SQLITE_OK) {
    QRVError e = QRV_ERROR(QRVResultCode::kDatabaseFailed, "table create for {} failed: {}", url.native(),
                           message ? message : sqlite3_errstr(rc));
    sqlite3_free(message);
    sqlite3_close(db);
    return fail(OpenFailure::kSchema, rc, std::move(e));
  }
  return db;
}

sqlite3* openDBWithURL(const std::filesystem::path& url) {
  OpenFailure failure = OpenFailure::kNone;
  int rc = SQLITE_OK;
  sqlite3* db = tryOpenDBWithURL(url, nullptr, &failure, &rc);
  if (db) return db;
  if (failure == OpenFailure::kOpen) crash(__func__, fmt::format("Failed to open database, err = {}", rc));
  crash(__func__, fmt::format("Failed to initialize database, err = {}", rc));
}

}  // namespace QRVSQLiteSchema

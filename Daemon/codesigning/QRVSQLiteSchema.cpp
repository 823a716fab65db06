#include "codesigning/QRVSQLiteSchema.h"

#include <sqlite3.h>
#include <unistd.h>

#include <cstdlib>

#include "base/QRVLog.h"

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

sqlite3* openDBWithURL(const std::filesystem::path& url) {
  QRVLogDebug("opening {}", url.native());
  sqlite3* db = nullptr;
  int rc = sqlite3_open_v2(url.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr);
  if (rc != SQLITE_OK) {
    QRVLogError("opening {} failed: {}", url.native(), db ? sqlite3_errmsg(db) : sqlite3_errstr(rc));
    sqlite3_close(db);
    crash(__func__, fmt::format("Failed to open database, err = {}", rc));
  }
  char* message = nullptr;
  rc = sqlite3_exec(db, kSchemaScript, nullptr, nullptr, &message);
  if (rc != SQLITE_OK) {
    QRVLogError("table create for {} failed: {}", url.native(), message ? message : sqlite3_errstr(rc));
    sqlite3_free(message);
    sqlite3_close(db);
    crash(__func__, fmt::format("Failed to initialize database, err = {}", rc));
  }
  return db;
}

}  // namespace QRVSQLiteSchema

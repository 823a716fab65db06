// The code-signing database's file format: the schema script that creates
// its tables, the statements that read and write them, and the opening of a
// file with the schema in place.
//
// The statements are part of the file format: another build of the daemon
// opens the same file, so they are kept exactly as they are.
#pragma once

#include <filesystem>

#include "base/QRVError.h"

struct sqlite3;

namespace QRVSQLiteSchema {

// Opens (creating if needed) the database at `url` and runs the schema
// script. Never returns null: a database that cannot be opened or set up
// terminates the daemon (see QRVSQLiteDB::openDBWithURL).
sqlite3* openDBWithURL(const std::filesystem::path& url);

// Which step of opening failed.
enum class OpenFailure { kNone, kOpen, kSchema };

// The same, for callers that can go on without the database: null when the
// file cannot be opened or the schema script fails (a corrupt file, one held
// by another connection in exclusive locking mode), with error 66, the step
// that failed and SQLite's result code. Nothing stays open on failure.
sqlite3* tryOpenDBWithURL(const std::filesystem::path& url, QRVError* error, OpenFailure* failure = nullptr,
                          int* sqliteResult = nullptr);

// Note on the pragmas: journal_mode = WAL writes the header of a new file
// before auto_vacuum = FULL runs, and SQLite only honours auto_vacuum on a
// file without a header, so a file created by this script does not
// auto-vacuum. The script is kept as it is so that existing databases and new
// ones agree.
inline constexpr const char* kSchemaScript =
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

inline constexpr const char* kDeleteSQL = "DELETE FROM code_signing_info WHERE code_signing_id_text=?;";
inline constexpr const char* kInvalidateSQL = "UPDATE code_signing_info SET invalid=1 WHERE code_signing_id_text = ?;";
inline constexpr const char* kSelectEntrySQL =
    "SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
    "code_signing_info.registered_by_caller, code_signing_info.data_container_class FROM "
    "code_signing_info, code_signing_data WHERE code_signing_info.id = "
    "code_signing_data.cs_info_id "
    "AND code_signing_info.code_signing_id_text = ?;";
inline constexpr const char* kEnumerateSQL =
    "SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
    "code_signing_info.registered_by_caller, code_signing_info.data_container_class, "
    "code_signing_info.code_signing_id_text FROM code_signing_info, code_signing_data WHERE "
    "code_signing_info.id = code_signing_data.cs_info_id;";
inline constexpr const char* kIdentifiersSQL = "SELECT code_signing_info.code_signing_id_text FROM code_signing_info;";
inline constexpr const char* kChildrenSQL =
    "SELECT child_bundles.child_code_signing_id_text FROM child_bundles, code_signing_info WHERE "
    "code_signing_info.code_signing_id_text = ? AND child_bundles.parent_id=code_signing_info.id;";
inline constexpr const char* kParentSQL =
    "SELECT code_signing_info.code_signing_id_text FROM child_bundles, code_signing_info WHERE "
    "child_bundles.child_code_signing_id_text = ? AND "
    "child_bundles.parent_id=code_signing_info.id;";
inline constexpr const char* kDeleteAdvanceCopiesSQL = "DELETE FROM code_signing_info WHERE (placeholder & ?) > 0;";
inline constexpr const char* kUpdateInfoSQL =
    "UPDATE code_signing_info SET invalid=?, placeholder=?, registered_by_caller=?, "
    "data_container_class=? WHERE code_signing_id_text=?;";
inline constexpr const char* kInsertInfoSQL =
    "INSERT INTO code_signing_info (invalid, placeholder, registered_by_caller, "
    "data_container_class, code_signing_id_text) VALUES (?, ?, ?, ?, ?);";
inline constexpr const char* kInsertDataSQL =
    "INSERT OR REPLACE INTO code_signing_data (cs_info_id, data) SELECT id, ? FROM "
    "code_signing_info WHERE code_signing_id_text = ?;";
inline constexpr const char* kInsertChildSQL =
    "INSERT OR REPLACE INTO child_bundles (parent_id, child_code_signing_id_text) SELECT id, ? "
    "FROM code_signing_info WHERE code_signing_id_text = ?;";

// The flag word of code_signing_info.placeholder.
inline constexpr int kPlaceholderBit = 1;
inline constexpr int kAdvanceCopyBit = 2;

}  // namespace QRVSQLiteSchema

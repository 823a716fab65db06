// The code-signing database against real SQLite files in a temporary
// directory. Faults are injected through SQLite itself (temporary triggers
// that refuse a row, a commit hook that refuses a commit), so the code under
// test meets the same errors it would meet in the field.
#include "codesigning/QRVSQLiteDB.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sqlite3.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <fstream>
#include <iterator>

#include "support/QRVLogCapture.h"
#include "support/QRVTestServices.h"

// Failures print entries as their description.
inline void PrintTo(const QRVCodeSigningEntry& e, std::ostream* os) { *os << e.description(); }

namespace fs = std::filesystem;
using ::testing::HasSubstr;
using ::testing::Not;
using ::testing::UnorderedElementsAre;

namespace {

QRVPlist infoWith(const std::string& marker) {
  QRVPlist entitlements;
  entitlements.set("marker", QRVPlist::string(marker));
  QRVPlist info;
  info.set("com.kelva.Quorva.Entitlements", std::move(entitlements));
  return info;
}

QRVCodeSigningEntry entryWith(const std::string& marker,
                              std::optional<std::vector<std::string>> children = std::nullopt) {
  QRVCodeSigningEntry entry(infoWith(marker), 2);
  entry.setChildBundleIdentifiers(std::move(children));
  return entry;
}

class QRVSQLiteDBTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_FALSE(dir_.empty());
    db_ = QRVSQLiteDB::initWithParentDirectoryURL(dir_);
    ASSERT_TRUE(db_);
  }
  void TearDown() override { db_.reset(); }

  void exec(const std::string& sql) {
    ASSERT_EQ(sqlite3_exec(db_->db(), sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK) << sql;
  }
  // The first column of the first row, bound to `text` when given; -1 when
  // there is no row.
  int64_t scalar(const std::string& sql, std::optional<std::string_view> text = std::nullopt) {
    sqlite3_stmt* s = nullptr;
    EXPECT_EQ(sqlite3_prepare_v2(db_->db(), sql.c_str(), -1, &s, nullptr), SQLITE_OK) << sql;
    if (text) sqlite3_bind_text64(s, 1, text->data(), text->size(), SQLITE_TRANSIENT, SQLITE_UTF8);
    int64_t v = sqlite3_step(s) == SQLITE_ROW ? sqlite3_column_int64(s, 0) : -1;
    sqlite3_finalize(s);
    return v;
  }
  int64_t rowId(std::string_view identifier) {
    return scalar("SELECT id FROM code_signing_info WHERE code_signing_id_text=?", identifier);
  }
  int64_t count(const std::string& table) { return scalar("SELECT count(*) FROM " + table); }
  void setBlob(std::string_view identifier, const void* bytes, int length) {
    sqlite3_stmt* s = nullptr;
    sqlite3_prepare_v2(db_->db(),
                       "UPDATE code_signing_data SET data=?1 WHERE cs_info_id=(SELECT id FROM code_signing_info "
                       "WHERE code_signing_id_text=?2)",
                       -1, &s, nullptr);
    sqlite3_bind_blob(s, 1, bytes, length, SQLITE_TRANSIENT);
    sqlite3_bind_text64(s, 2, identifier.data(), identifier.size(), SQLITE_TRANSIENT, SQLITE_UTF8);
    ASSERT_EQ(sqlite3_step(s), SQLITE_DONE);
    sqlite3_finalize(s);
  }
  // The stored entry; an empty entry, and a failure, when there is none.
  QRVCodeSigningEntry lookUp(std::string_view identifier) {
    QRVError error;
    auto entry = db_->codeSigningEntryWithIdentifier(identifier, &error);
    if (!entry) ADD_FAILURE() << error.description();
    return entry ? *entry : QRVCodeSigningEntry();
  }
  std::vector<std::string> children(std::string_view identifier) {
    return lookUp(identifier).childBundleIdentifiers().value_or(std::vector<std::string>());
  }
  void add(const QRVCodeSigningEntry& entry, std::string_view identifier) {
    QRVError error;
    ASSERT_TRUE(db_->addCodeSigningEntry(&entry, identifier, &error)) << error.description();
  }

  // The code a call that took `&error_` failed with; 0 when it succeeded.
  // Clears the error, so that no result is read from an earlier call.
  uint64_t failed(bool ok) {
    uint64_t code = ok ? 0 : error_.code();
    error_ = QRVError();
    return code;
  }

  QRVError error_;
  QRVTemporaryDirectory temporary_;
  const fs::path dir_ = temporary_.path();
  std::unique_ptr<QRVSQLiteDB> db_;
};

std::string runSqlite3(const fs::path& file, const std::string& command) {
  FILE* p = popen(("sqlite3 '" + file.string() + "' '" + command + "' 2>&1").c_str(), "r");
  std::string out;
  char buffer[4096];
  for (size_t n; p && (n = fread(buffer, 1, sizeof buffer, p)) > 0;) out.append(buffer, n);
  if (p) pclose(p);
  return out;
}

// MARK: - Opening

TEST_F(QRVSQLiteDBTest, HoldsTheFileExclusivelyAndReopensOverExistingTables) {
  if (system("command -v sqlite3 >/dev/null 2>&1") != 0) GTEST_SKIP() << "no sqlite3 binary";
  const fs::path file = dir_ / "containers.sqlite3";
  EXPECT_EQ(db_->url(), file);
  EXPECT_EQ(scalar("PRAGMA foreign_keys"), 1);  // the cascades depend on it
  add(entryWith("x"), "com.example.app");
  // Exclusive locking keeps every other process out while the daemon runs.
  EXPECT_THAT(runSqlite3(file, "SELECT count(*) FROM code_signing_info;"), HasSubstr("database is locked"));

  db_->closeDB();
  // The file outlives daemon versions: its tables are pinned word for word.
  EXPECT_EQ(
      runSqlite3(file, ".schema"),
      "CREATE TABLE code_signing_info(id INTEGER PRIMARY KEY AUTOINCREMENT,code_signing_id_text "
      "TEXT NOT NULL UNIQUE,invalid INTEGER NOT NULL DEFAULT 0,placeholder INTEGER NOT NULL "
      "DEFAULT 0,registered_by_caller INTEGER NOT NULL DEFAULT 0,data_container_class INTEGER "
      "NOT NULL DEFAULT 0);\n"
      "CREATE TABLE sqlite_sequence(name,seq);\n"
      "CREATE TABLE code_signing_data(id INTEGER PRIMARY KEY AUTOINCREMENT,cs_info_id INTEGER "
      "NOT NULL UNIQUE,data BLOB NOT NULL,FOREIGN KEY(cs_info_id) REFERENCES "
      "code_signing_info(id) ON DELETE CASCADE);\n"
      "CREATE TABLE child_bundles(id INTEGER PRIMARY KEY AUTOINCREMENT,child_code_signing_id_text "
      "TEXT NOT NULL UNIQUE,parent_id INTEGER NOT NULL,FOREIGN KEY(parent_id) REFERENCES "
      "code_signing_info(id) ON DELETE CASCADE);\n"
      "CREATE INDEX code_signing_id_text_idx ON code_signing_info(code_signing_id_text);\n"
      "CREATE INDEX cs_info_id_idx ON code_signing_data(cs_info_id);\n"
      "CREATE INDEX parent_id_idx ON child_bundles(parent_id);\n");
  EXPECT_EQ(runSqlite3(file, "PRAGMA journal_mode;"), "wal\n");
  EXPECT_EQ(failed(db_->identifiersWithError(&error_).has_value()), 66u);  // closed: every call fails
  db_ = QRVSQLiteDB::initWithParentDirectoryURL(dir_);
  EXPECT_TRUE(db_->codeSigningEntryWithIdentifier("com.example.app", nullptr));
}

// Every entitlement decision depends on the database, so the daemon must not
// run on without it.
TEST(QRVSQLiteDBDeathTest, AFileThatCannotBeOpenedOrSetUpTerminates) {
  // "fast" (fork) style: the child must not re-run the test's set-up, which
  // for the locked file would start a second lock holder.
  GTEST_FLAG_SET(death_test_style, "fast");
  QRVTemporaryDirectory missing, corrupt, held;
  EXPECT_DEATH(QRVSQLiteDB::initWithParentDirectoryURL(fs::path(missing.path()) / "missing"),
               "opening .*containers.sqlite3 failed: unable to open database file.*Failed to open database, err = 14");

  std::ofstream(fs::path(corrupt.path()) / "containers.sqlite3") << std::string(8192, 'Z');
  EXPECT_DEATH(QRVSQLiteDB::initWithParentDirectoryURL(corrupt.path()),
               "table create for .* failed: file is not a database.*Failed to initialize database, err = 26");

  int ready[2];
  ASSERT_EQ(pipe(ready), 0);
  pid_t holder = fork();
  ASSERT_GE(holder, 0);
  if (holder == 0) {
    sqlite3* db = nullptr;
    sqlite3_open((fs::path(held.path()) / "containers.sqlite3").c_str(), &db);
    char c = sqlite3_exec(db, "BEGIN EXCLUSIVE;", nullptr, nullptr, nullptr) == SQLITE_OK ? 'y' : 'n';
    (void)!write(ready[1], &c, 1);
    pause();
    _exit(0);
  }
  char c = 0;
  EXPECT_EQ(read(ready[0], &c, 1), 1);
  EXPECT_EQ(c, 'y');
  EXPECT_DEATH(QRVSQLiteDB::initWithParentDirectoryURL(held.path()),
               "table create for .* failed: database is locked.*Failed to initialize database, err = 5");
  kill(holder, SIGKILL);
  waitpid(holder, nullptr, 0);
  close(ready[0]);
  close(ready[1]);
}

// MARK: - Adding and updating

TEST_F(QRVSQLiteDBTest, AddingAgainUpdatesInPlaceKeepsChildrenAndMovesClaimedChildren) {
  QRVCodeSigningEntry first = entryWith("v1", {{"com.example.app.one"}});
  first.setRegisteredByCaller(true);
  add(first, "com.example.app");
  EXPECT_EQ(lookUp("com.example.app"), first);
  const int64_t id = rowId("com.example.app");

  QRVCodeSigningEntry second = entryWith("v2", {{"com.example.app.two"}});
  second.setInvalid(true);
  second.setDataContainerClass(4);
  add(second, "com.example.app");
  EXPECT_EQ(rowId("com.example.app"), id);
  EXPECT_EQ(count("code_signing_data"), 1);
  EXPECT_EQ(scalar("SELECT cs_info_id FROM code_signing_data"), id);
  QRVCodeSigningEntry stored = lookUp("com.example.app");
  EXPECT_EQ(stored.codeSigningInfo(), infoWith("v2"));
  EXPECT_TRUE(stored.isInvalid());
  EXPECT_FALSE(stored.isRegisteredByCaller());
  EXPECT_EQ(stored.dataContainerClass(), 4u);
  EXPECT_THAT(children("com.example.app"), UnorderedElementsAre("com.example.app.one", "com.example.app.two"));

  // A child claimed by another parent moves to it.
  add(entryWith("b", {{"com.example.app.one"}}), "com.example.b");
  EXPECT_EQ(db_->parentIdentifierForChildIdentifier("com.example.app.one", nullptr), "com.example.b");
  EXPECT_THAT(children("com.example.app"), UnorderedElementsAre("com.example.app.two"));
  EXPECT_EQ(count("child_bundles"), 2);
}

TEST_F(QRVSQLiteDBTest, RefusedChildIsSkippedButRefusedDataRollsBack) {
  exec(
      "CREATE TEMP TRIGGER refuse_child BEFORE INSERT ON child_bundles WHEN NEW.child_code_signing_id_text='bad' "
      "BEGIN SELECT RAISE(ABORT, 'refused'); END;");
  add(entryWith("p", {{"bad", "good"}}), "com.example.parent");
  EXPECT_THAT(children("com.example.parent"), UnorderedElementsAre("good"));

  exec("CREATE TEMP TRIGGER refuse_data BEFORE INSERT ON code_signing_data BEGIN SELECT RAISE(ABORT, 'no'); END;");
  QRVCodeSigningEntry entry = entryWith("q");
  EXPECT_EQ(failed(db_->addCodeSigningEntry(&entry, "com.example.new", &error_)), 66u);
  EXPECT_EQ(rowId("com.example.new"), -1);  // the info row went with the rollback
}

TEST_F(QRVSQLiteDBTest, RefusesMissingArguments) {
  QRVCodeSigningEntry entry = entryWith("x"), noDictionary;
  EXPECT_EQ(failed(db_->addCodeSigningEntry(nullptr, "a", &error_)), 38u);
  EXPECT_EQ(failed(db_->addCodeSigningEntry(&entry, std::nullopt, &error_)), 38u);
  EXPECT_EQ(failed(db_->deleteCodeSigningEntryWithIdentifier(std::nullopt, &error_)), 38u);
  EXPECT_EQ(failed(db_->addCodeSigningEntry(&noDictionary, "a", &error_)), 66u);
  EXPECT_EQ(rowId("a"), -1);
}

TEST_F(QRVSQLiteDBTest, AdvanceCopiesShareTheFlagWordAndAreDeletedWholesale) {
  QRVCodeSigningEntry both = entryWith("both", {{"com.example.both.child"}}), advance = entryWith("advance"),
                      placeholder = entryWith("placeholder");
  both.setPlaceholder(true);
  both.setAdvanceCopy(true);
  advance.setAdvanceCopy(true);
  placeholder.setPlaceholder(true);
  add(both, "both");
  add(advance, "advance");
  add(placeholder, "placeholder");
  const char* flags = "SELECT placeholder FROM code_signing_info WHERE code_signing_id_text=?";
  EXPECT_EQ(scalar(flags, "both"), 3);
  EXPECT_EQ(scalar(flags, "advance"), 2);
  EXPECT_EQ(scalar(flags, "placeholder"), 1);
  EXPECT_EQ(lookUp("both"), both);

  ASSERT_TRUE(db_->deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(&error_));
  EXPECT_THAT(db_->identifiersWithError(&error_).value_or(std::vector<std::string>()),
              UnorderedElementsAre("placeholder"));
  EXPECT_EQ(count("code_signing_data"), 1);
  EXPECT_EQ(count("child_bundles"), 0);
}

// MARK: - Deleting, invalidating, not found

TEST_F(QRVSQLiteDBTest, DeletingUnknownFailsButInvalidatingUnknownChangesNothing) {
  add(entryWith("p", {{"com.example.child"}}), "com.example.parent");
  ASSERT_TRUE(db_->deleteCodeSigningEntryWithIdentifier("com.example.parent", &error_));
  EXPECT_EQ(count("code_signing_data"), 0);
  EXPECT_EQ(count("child_bundles"), 0);

  EXPECT_FALSE(db_->deleteCodeSigningEntryWithIdentifier("com.example.parent", &error_));
  EXPECT_EQ(error_.code(), 66u);
  ASSERT_NE(error_.underlying(), nullptr);
  EXPECT_EQ(error_.underlying()->code(), 68u);

  add(entryWith("a"), "com.example.a");
  const int before = sqlite3_total_changes(db_->db());
  EXPECT_TRUE(db_->invalidateCodeSigningWithIdentifier("com.example.unknown", &error_));
  EXPECT_EQ(sqlite3_total_changes(db_->db()), before);
}

TEST_F(QRVSQLiteDBTest, InvalidatesParentAndChildrenInOneTransaction) {
  add(entryWith("p", {{"com.example.p.one", "com.example.p.two"}}), "com.example.p");
  for (const char* other : {"com.example.p.one", "com.example.p.two", "com.example.other"})
    add(entryWith(other), other);
  int commits = 0;
  sqlite3_commit_hook(
      db_->db(),
      [](void* count) {
        ++*static_cast<int*>(count);
        return 0;
      },
      &commits);
  ASSERT_TRUE(db_->invalidateCodeSigningForIdentifierAndAllChildren("com.example.p", &error_));
  EXPECT_EQ(commits, 1);
  EXPECT_EQ(scalar("SELECT count(*) FROM code_signing_info WHERE invalid=1"), 3);
  EXPECT_FALSE(lookUp("com.example.other").isInvalid());
}

TEST_F(QRVSQLiteDBTest, NotFoundIs67AndIsNotLogged) {
  QRVLogCapture log(dir_);
  add(entryWith("lonely"), "com.example.lonely");
  EXPECT_EQ(failed(db_->codeSigningEntryWithIdentifier("com.example.nobody", &error_) != nullptr), 67u);
  EXPECT_EQ(failed(db_->childIdentifiersForParentIdentifier("com.example.lonely", &error_).has_value()), 67u);
  EXPECT_EQ(failed(db_->parentIdentifierForChildIdentifier("com.example.lonely", &error_).has_value()), 67u);
  EXPECT_FALSE(lookUp("com.example.lonely").childBundleIdentifiers());
  EXPECT_THAT(log.text(), Not(HasSubstr("Not Found")));
}

TEST_F(QRVSQLiteDBTest, UnreadableBlobFailsLookUpAndIsSkippedByEnumeration) {
  add(entryWith("a"), "a");
  add(entryWith("b", {{"b.child"}}), "b");
  add(entryWith("c"), "c");
  const QRVPlist::Bytes array = QRVPlist::array({QRVPlist::string("x")}).toBinary();
  setBlob("b", array.data(), static_cast<int>(array.size()));
  setBlob("c", "\x01\x02garbage", 9);
  setBlob("a", "", 0);
  for (const char* unreadable : {"a", "b", "c"})
    EXPECT_EQ(failed(db_->codeSigningEntryWithIdentifier(unreadable, &error_) != nullptr), 66u) << unreadable;

  add(entryWith("d", {{"d.child"}}), "d");
  std::vector<std::string> seen;
  auto walkError = db_->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
      [&](const std::string& identifier, const std::shared_ptr<const QRVCodeSigningEntry>& entry) {
        seen.push_back(identifier);
        EXPECT_EQ(*entry, entryWith("d", {{"d.child"}}));
      });
  EXPECT_FALSE(walkError);
  EXPECT_THAT(seen, UnorderedElementsAre("d"));
}

// MARK: - Transactions

TEST_F(QRVSQLiteDBTest, FailingCommitIsReportedAsSuccessByAddOnlyAndLeavesNoTransactionOpen) {
  QRVLogCapture log(dir_);
  add(entryWith("p", {{"com.example.child"}}), "com.example.p");
  sqlite3_commit_hook(
      db_->db(), [](void*) { return 1; }, nullptr);  // every COMMIT fails
  QRVCodeSigningEntry entry = entryWith("new");
  EXPECT_TRUE(db_->addCodeSigningEntry(&entry, "com.example.new", &error_));
  EXPECT_THAT(log.text(), HasSubstr("failed _sqliteExec commit"));
  EXPECT_EQ(failed(db_->invalidateCodeSigningForIdentifierAndAllChildren("com.example.p", &error_)), 66u);

  sqlite3_commit_hook(db_->db(), nullptr, nullptr);
  EXPECT_EQ(rowId("com.example.new"), -1);  // the refused commit rolled it back
  add(entryWith("later"), "com.example.later");
}

TEST_F(QRVSQLiteDBTest, ExceptionInsideTransactionRollsBackWith40) {
  std::exception_ptr reported;
  db_ = nullptr;
  db_ = QRVSQLiteDB::initWithParentDirectoryURL(dir_, [&](std::exception_ptr e) { reported = e; });
  add(entryWith("p", {{"com.example.child"}}), "com.example.p");
  db_->TEST_setInsideTransactionHook([] { throw std::runtime_error("boom"); });

  QRVCodeSigningEntry entry = entryWith("new");
  EXPECT_FALSE(db_->addCodeSigningEntry(&entry, "com.example.new", &error_));
  EXPECT_EQ(error_.code(), 40u);
  EXPECT_THAT(error_.message(), HasSubstr("boom"));
  EXPECT_TRUE(reported);
  EXPECT_EQ(rowId("com.example.new"), -1);
  error_ = QRVError();
  EXPECT_EQ(failed(db_->invalidateCodeSigningForIdentifierAndAllChildren("com.example.p", &error_)), 40u);
  EXPECT_EQ(scalar("SELECT count(*) FROM code_signing_info WHERE invalid=1"), 0);

  db_->TEST_setInsideTransactionHook(nullptr);
  add(entryWith("after"), "com.example.after");  // no transaction was left open
}

// MARK: - Hostile identifiers

TEST_F(QRVSQLiteDBTest, HostileIdentifiersAreBoundAsBytes) {
  const std::vector<std::string> hostile = {"x'); DROP TABLE code_signing_info; --",
                                            "quote\"d",
                                            std::string("nul\0middle", 10),
                                            std::string(1 << 20, 'L'),
                                            "\xff\xfe\xc3(not utf-8",
                                            "",
                                            "{} %s %@"};
  for (const auto& identifier : hostile) {
    const std::string child = identifier + std::string("\0child", 6);
    add(entryWith("hostile", {{child}}), identifier);
    EXPECT_EQ(lookUp(identifier), entryWith("hostile", {{child}})) << identifier.size();
    EXPECT_EQ(db_->parentIdentifierForChildIdentifier(child, nullptr), identifier);
  }
  EXPECT_THAT(db_->identifiersWithError(&error_).value_or(std::vector<std::string>()),
              ::testing::UnorderedElementsAreArray(hostile));
  EXPECT_EQ(failed(db_->codeSigningEntryWithIdentifier("nul", &error_) != nullptr), 67u);  // not the NUL's prefix
  for (const auto& identifier : hostile)
    EXPECT_TRUE(db_->deleteCodeSigningEntryWithIdentifier(identifier, &error_)) << error_.description();
  EXPECT_EQ(count("child_bundles"), 0);
}

}  // namespace

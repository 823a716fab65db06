#include "codesigning/QRVSQLiteStatement.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <string>

namespace {

using ::testing::HasSubstr;
using Step = QRVSQLiteStatement::Step;

class QRVSQLiteStatementTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(sqlite3_open(":memory:", &db_), SQLITE_OK);
    ASSERT_EQ(sqlite3_exec(db_, "CREATE TABLE t(s, i, b);", nullptr, nullptr, nullptr), SQLITE_OK);
  }
  void TearDown() override {
    // Every statement was finalized: close would fail with SQLITE_BUSY.
    EXPECT_EQ(sqlite3_next_stmt(db_, nullptr), nullptr);
    EXPECT_EQ(sqlite3_close(db_), SQLITE_OK);
  }

  sqlite3* db_ = nullptr;
  const std::string path_ = ":memory:";
};

TEST_F(QRVSQLiteStatementTest, BadSQLIsNotPreparedAndSaysWhy) {
  QRVSQLiteStatement statement(db_, "SELEKT 1;", path_);
  EXPECT_FALSE(statement.prepared());
  EXPECT_THAT(statement.errorMessage(), HasSubstr("syntax error"));
}

TEST_F(QRVSQLiteStatementTest, AClosedConnectionPreparesNothing) {
  QRVSQLiteStatement statement(nullptr, "SELECT 1;", path_);
  EXPECT_FALSE(statement.prepared());
  EXPECT_STREQ(statement.errorMessage(), "database is closed");
}

TEST_F(QRVSQLiteStatementTest, TextIntAndBlobRoundTripByteForByte) {
  // A NUL inside, bytes that are not UTF-8, and a blob that is not text.
  const std::string text("a\0b\xff\xfe", 5);
  const unsigned char blob[] = {0, 1, 2, 0xff};
  {
    QRVSQLiteStatement insert(db_, "INSERT INTO t VALUES (?, ?, ?);", path_);
    ASSERT_TRUE(insert.prepared());
    EXPECT_TRUE(insert.bindText(1, text));
    EXPECT_TRUE(insert.bindInt(2, -7));
    EXPECT_TRUE(insert.bindBlob(3, blob, sizeof blob));
    EXPECT_EQ(insert.step(), Step::kDone);
    EXPECT_EQ(insert.changes(), 1);
  }
  QRVSQLiteStatement select(db_, "SELECT s, i, b FROM t;", path_);
  ASSERT_TRUE(select.prepared());
  ASSERT_EQ(select.step(), Step::kRow);
  ASSERT_TRUE(select.columnText(0));
  EXPECT_EQ(*select.columnText(0), text);
  EXPECT_EQ(select.columnInt(1), -7);
  size_t length = 0;
  const uint8_t* bytes = select.columnBlob(2, &length);
  ASSERT_NE(bytes, nullptr);
  EXPECT_EQ(std::string(bytes, bytes + length), std::string(blob, blob + sizeof blob));
  EXPECT_EQ(select.step(), Step::kDone);
}

TEST_F(QRVSQLiteStatementTest, AnEmptyViewIsBoundAsEmptyTextNotNull) {
  {
    QRVSQLiteStatement insert(db_, "INSERT INTO t (s) VALUES (?);", path_);
    ASSERT_TRUE(insert.prepared());
    EXPECT_TRUE(insert.bindText(1, std::string_view()));
    EXPECT_EQ(insert.step(), Step::kDone);
  }
  QRVSQLiteStatement select(db_, "SELECT s, b, typeof(s) FROM t;", path_);
  ASSERT_EQ(select.step(), Step::kRow);
  EXPECT_EQ(select.columnText(2), "text");
  ASSERT_TRUE(select.columnText(0));
  EXPECT_TRUE(select.columnText(0)->empty());
  // The column left out is NULL, which reads as no text at all.
  EXPECT_FALSE(select.columnText(1));
}

TEST_F(QRVSQLiteStatementTest, AStatementLeftInTheMiddleOfItsRowsIsFinalized) {
  ASSERT_EQ(sqlite3_exec(db_, "INSERT INTO t (i) VALUES (1), (2);", nullptr, nullptr, nullptr), SQLITE_OK);
  {
    QRVSQLiteStatement select(db_, "SELECT i FROM t;", path_);
    ASSERT_EQ(select.step(), Step::kRow);
  }
  // Checked in TearDown; a write here would fail while a read was pending.
  EXPECT_EQ(sqlite3_exec(db_, "DROP TABLE t;", nullptr, nullptr, nullptr), SQLITE_OK);
}

TEST_F(QRVSQLiteStatementTest, AFailedStepIsReportedWithTheConnectionsMessage) {
  ASSERT_EQ(sqlite3_exec(db_, "CREATE TABLE u(x NOT NULL);", nullptr, nullptr, nullptr), SQLITE_OK);
  QRVSQLiteStatement insert(db_, "INSERT INTO u VALUES (NULL);", path_);
  ASSERT_TRUE(insert.prepared());
  EXPECT_EQ(insert.step(), Step::kError);
  EXPECT_THAT(insert.errorMessage(), HasSubstr("NOT NULL"));
}

}  // namespace

#include <gtest/gtest.h>
#include <stdlib.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <set>
#include <sstream>

#include "base/QRVError.h"
#include "base/QRVLog.h"
#include "support/QRVTestServices.h"

namespace {

namespace fs = std::filesystem;

// A fresh directory for one test's logs; the log is closed before it goes.
struct LogDir {
  QRVTemporaryDirectory dir;
  fs::path path = dir.path();
  ~LogDir() { QRVLog::close(); }
  std::string log() const { return (path / "quorvad.log").string(); }
  std::string read(const std::string& name = "quorvad.log") const {
    std::stringstream ss;
    ss << std::ifstream(path / name).rdbuf();
    return ss.str();
  }
};

size_t count(const std::string& text, const std::string& needle) {
  size_t n = 0;
  for (size_t at = text.find(needle); at != std::string::npos; at = text.find(needle, at + 1)) n++;
  return n;
}

int quietLine;
QRVError quietFailure() {
  quietLine = __LINE__ + 1;
  return QRV_ERROR_QUIET(QRVResultCode::kInvalidInput, "bad {} for {}", "value", 7);
}
QRVError posixFailure() { return QRV_POSIX_ERROR(ENOENT, "no {}", "file"); }

void errorHere(const char* what) { QRVLogError("error {}", what); }
void noticeHere(const char* what) { QRVLogNotice("notice {}", what); }
void infoHere(const char* what) { QRVLogInfo("info {}", what); }
void debugHere(const char* what) { QRVLogDebug("debug {}", what); }

TEST(QRVErrorTest, BuilderFillsEveryFieldAndChainsUnderlying) {
  QRVError e = quietFailure();
  EXPECT_EQ(e.description(), fmt::format("QRVErrorDomain 38: bad value for 7 (quietFailure:{})", quietLine));
  EXPECT_FALSE(e.isPOSIX());

  testing::internal::CaptureStderr();  // both are logged; there is no handle
  QRVError posix = posixFailure();
  QRVError outer = QRV_ERROR_UNDERLYING(QRVResultCode::kException, posix, "could not {}", "open");
  const int outerLine = __LINE__ - 1;
  testing::internal::GetCapturedStderr();
  EXPECT_TRUE(posix.isPOSIX());
  ASSERT_NE(outer.underlying(), nullptr);
  EXPECT_EQ(outer.underlying()->functionName(), "posixFailure");
  EXPECT_EQ(outer.description(), fmt::format("QRVErrorDomain 40: could not open (TestBody:{}) <- POSIXErrorDomain 2: "
                                             "no file (posixFailure:{})",
                                             outerLine, posix.sourceFileLine()));
  QRVError stored;
  EXPECT_FALSE(QRVFail(&stored, e));
  EXPECT_EQ(stored.description(), e.description());
  EXPECT_FALSE(QRVFail(nullptr, e));
}

TEST(QRVLogTest, ErrorsAreLoggedOnceAndQuietErrorsNotAtAll) {
  LogDir dir;
  ASSERT_TRUE(QRVLog::open("test", dir.log(), QRVLogLevel::kNotice, 2, 1 << 20));
  QRV_ERROR(QRVResultCode::kInvalidCommand, "loud {}", 1);
  QRVError quiet = QRV_ERROR_QUIET(QRVResultCode::kInvalidCommand, "quiet {}", 2);
  QRV_ERROR_UNDERLYING(QRVResultCode::kException, quiet, "chained {}", 3);
  QRVLog::close();
  std::string log = dir.read();
  EXPECT_EQ(count(log, "<Error> TestBody: QRVErrorDomain 49: loud 1 (TestBody:"), 1u) << log;
  EXPECT_EQ(count(log, "chained 3"), 1u) << log;
  EXPECT_EQ(count(log, "quiet 2"), 1u) << log;  // only within the error it caused
  EXPECT_EQ(count(log, "\n"), 2u) << log;
}

TEST(QRVLogTest, HandleLevelDecidesWhatIsWritten) {
  LogDir dir;
  ASSERT_TRUE(QRVLog::open("test", dir.log(), QRVLogLevel::kNotice, 2, 1 << 20));
  EXPECT_TRUE(QRVLog::isEnabled(QRVLogLevel::kNotice) && !QRVLog::isEnabled(QRVLogLevel::kInfo));
  for (auto write : {errorHere, noticeHere, infoHere, debugHere}) write("one");
  QRVLog::setLevel(QRVLogLevel::kDebug);
  for (auto write : {infoHere, debugHere}) write("two");
  QRVLog::setLevel(QRVLogLevel::kError);
  for (auto write : {noticeHere, errorHere}) write("three");
  QRVLog::close();
  EXPECT_FALSE(QRVLog::hasHandle());
  std::string log = dir.read();
  for (const char* line :
       {"<Error> errorHere: error one\n", "<Notice> noticeHere: notice one\n", "<Info> infoHere: info two\n",
        "<Debug> debugHere: debug two\n", "<Error> errorHere: error three\n"})
    EXPECT_EQ(count(log, line), 1u) << line << log;
  EXPECT_EQ(count(log, "\n"), 5u) << log;
}

TEST(QRVLogTest, WithoutHandleErrorsAndNoticesGoToStderr) {
  QRVLog::close();
  EXPECT_TRUE(QRVLog::isEnabled(QRVLogLevel::kNotice) && !QRVLog::isEnabled(QRVLogLevel::kInfo));
  testing::internal::CaptureStderr();
  for (auto write : {errorHere, noticeHere, infoHere, debugHere}) write("out");
  QRVLog::write(QRVLogLevel::kDebug, "direct", "debug written directly");
  std::string err = testing::internal::GetCapturedStderr();
  // Under systemd the level travels as the journal's "<N>" prefix instead.
  const bool journal = getenv("JOURNAL_STREAM") != nullptr;
  EXPECT_EQ(count(err, journal ? "<3>quorvad: errorHere: error out\n" : "<Error> errorHere: error out\n"), 1u) << err;
  EXPECT_EQ(count(err, journal ? "<5>quorvad: noticeHere: notice out\n" : "<Notice> noticeHere: notice out\n"), 1u)
      << err;
  EXPECT_EQ(count(err, "\n"), 2u) << err;
}

TEST(QRVLogTest, OpenOnUnwritablePathFailsAndLeavesNoHandle) {
  LogDir dir;
  ASSERT_TRUE(QRVLog::open("test", dir.log(), QRVLogLevel::kNotice, 2, 1 << 20));
  std::ofstream(dir.path / "plain") << "x";  // no directory beneath a file, even for root
  const std::string bad = (dir.path / "plain" / "logs" / "quorvad.log").string();
  testing::internal::CaptureStderr();
  EXPECT_FALSE(QRVLog::open("test", bad, QRVLogLevel::kNotice, 2, 1 << 20));
  std::string err = testing::internal::GetCapturedStderr();
  EXPECT_EQ(count(err, "Failed to set up rotating logs at path " + bad), 1u) << err;
  EXPECT_FALSE(QRVLog::hasHandle());
}

TEST(QRVLogTest, RotationKeepsTheRequestedNumberOfFiles) {
  LogDir dir;
  ASSERT_TRUE(QRVLog::open("test", dir.log(), QRVLogLevel::kNotice, 1, 4096));
  for (int i = 0; i < 200; i++) noticeHere(fmt::format("{} {}", i, std::string(100, 'x')).c_str());
  QRVLog::close();
  std::set<std::string> names;
  for (const auto& entry : fs::directory_iterator(dir.path)) names.insert(entry.path().filename());
  EXPECT_EQ(names, (std::set<std::string>{"quorvad.log", "quorvad.1.log"}));
  EXPECT_LE(fs::file_size(dir.path / "quorvad.1.log"), 4096u);
  EXPECT_EQ(count(dir.read(), "notice 199 x"), 1u);  // newest kept, oldest gone
  EXPECT_EQ(count(dir.read("quorvad.1.log"), "notice 0 x"), 0u);
}

}  // namespace

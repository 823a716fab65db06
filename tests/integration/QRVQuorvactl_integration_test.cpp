// The quorvactl tool against the real daemon: typed subcommands, their JSON
// output and exit statuses.
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>

#include "integration/QRVDaemonProcess.h"

namespace {

struct ToolRun {
  int status = -1;  // exit status, -1 when it did not exit normally
  std::string out;
};

// Runs quorvactl with `arguments` (already shell-quoted where needed).
ToolRun quorvactl(const std::string& arguments) {
  ToolRun run;
  std::string line = std::string(QUORVACTL_BINARY) + " " + arguments + " 2>/dev/null";
  FILE* pipe = popen(line.c_str(), "r");
  if (!pipe) return run;
  char buffer[4096];
  for (size_t n; (n = fread(buffer, 1, sizeof buffer, pipe)) > 0;) run.out.append(buffer, n);
  int status = pclose(pipe);
  if (WIFEXITED(status)) run.status = WEXITSTATUS(status);
  return run;
}

// The string value of `key` in quorvactl's JSON output; empty when absent.
std::string jsonString(const std::string& json, const std::string& key) {
  size_t at = json.find("\"" + key + "\": \"");
  if (at == std::string::npos) return {};
  at += key.size() + 5;
  return json.substr(at, json.find('"', at) - at);
}

class QuorvactlIntegrationTest : public testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root to run the daemon";
    daemon_.trustEntry("quorvactl", QRVPlist::dictionary()
                                        .set("SigningIdentifier", QRVPlist::string("com.kelva.quorvactl"))
                                        .set("Executable", QRVPlist::string(QUORVACTL_BINARY))
                                        .set("Entitlements", QRVPlist::dictionary().set(
                                                                 "com.kelva.private.Quorva.allowed",
                                                                 QRVPlist::boolean(true))));
    daemon_.start();
    root_ = "--root " + daemon_.root();
  }
  QRVDaemonProcess daemon_;
  std::string root_;
};

TEST_F(QuorvactlIntegrationTest, LookupFeedsTypedCallsListsAndRefuses) {
  ToolRun created = quorvactl(root_ + " --json lookup --id com.example.ctl --class 1 --create");
  ASSERT_EQ(created.status, 0) << created.out;
  EXPECT_NE(created.out.find("\"ReplyError\": 1"), std::string::npos) << created.out;
  EXPECT_NE(created.out.find("\"ReplyExisted\": false"), std::string::npos) << created.out;
  EXPECT_NE(created.out.find("\"ReplyIdentifier\": \"com.example.ctl\""), std::string::npos) << created.out;
  // The path printed is a directory the daemon made.
  std::string path = jsonString(created.out, "ReplyPath");
  ASSERT_TRUE(std::filesystem::is_directory(path)) << created.out;

  // Looked up again (human output), it now existed.
  ToolRun again = quorvactl(root_ + " lookup --id com.example.ctl --class 1");
  EXPECT_EQ(again.status, 0) << again.out;
  EXPECT_NE(again.out.find("ReplyExisted = true"), std::string::npos) << again.out;
  EXPECT_NE(again.out.find("ReplyPath = " + path), std::string::npos) << again.out;

  // The UUID as --json prints it feeds the calls that need one.
  std::string uuid = jsonString(created.out, "ReplyUUID");
  ASSERT_EQ(uuid.size(), 32u) << created.out;
  std::string container = " --id com.example.ctl --class 1 --uuid " + uuid;
  EXPECT_EQ(quorvactl(root_ + " info-set" + container + " --key Color --value blue").status, 0);
  ToolRun info = quorvactl(root_ + " --json info-get" + container + " --key Color");
  EXPECT_EQ(info.status, 0) << info.out;
  EXPECT_EQ(jsonString(info.out, "ReplyInfoValue"), "blue") << info.out;
  ToolRun metadata = quorvactl(root_ + " --json metadata --info" + container);
  EXPECT_EQ(metadata.status, 0) << metadata.out;
  EXPECT_NE(metadata.out.find("\"Color\": \"blue\""), std::string::npos) << metadata.out;
  EXPECT_NE(metadata.out.find("\"ReplyTransient\": false"), std::string::npos) << metadata.out;
  ToolRun usage = quorvactl(root_ + " disk-usage" + container);
  EXPECT_EQ(usage.status, 0) << usage.out;
  EXPECT_NE(usage.out.find("ReplyDiskUsage = "), std::string::npos) << usage.out;

  ToolRun list = quorvactl("list --class 1 --json " + root_);
  EXPECT_EQ(list.status, 0) << list.out;
  EXPECT_NE(list.out.find("\"com.example.ctl\""), std::string::npos) << list.out;

  // A class the daemon does not know is refused: exit 1 and the daemon's code.
  ToolRun refused = quorvactl(root_ + " --json lookup --id com.example.ctl --class 999 --create");
  EXPECT_EQ(refused.status, 1) << refused.out;
  EXPECT_NE(refused.out.find("\"ReplyError\": "), std::string::npos);
  EXPECT_EQ(refused.out.find("\"ReplyError\": 1,"), std::string::npos) << refused.out;
  EXPECT_EQ(refused.out.find("ReplyPath"), std::string::npos) << refused.out;

  // The migrations answer when done; "allowed" may run both.
  EXPECT_EQ(quorvactl(root_ + " per-user-migration").status, 0);
  ToolRun migrator = quorvactl(root_ + " --json data-migration");
  EXPECT_EQ(migrator.status, 0) << migrator.out;
  EXPECT_NE(migrator.out.find("\"ReplyError\": 1"), std::string::npos) << migrator.out;

  // Usage errors never reach the daemon.
  EXPECT_EQ(quorvactl(root_ + " per-user-migration --id x").status, 2);
  EXPECT_EQ(quorvactl(root_ + " lookup --class 1").status, 2);
  EXPECT_EQ(quorvactl(root_ + " list --class 1 --uuid x").status, 2);
}

// set-data-protection answers with the daemon's code; the class it set is
// what the container's info then records.
TEST_F(QuorvactlIntegrationTest, SetDataProtectionChangesAndRecordsTheClass) {
  ToolRun created = quorvactl(root_ + " --json lookup --id com.example.dp --class 2 --create");
  ASSERT_EQ(created.status, 0) << created.out;
  const std::string container = " --id com.example.dp --class 2";
  EXPECT_EQ(quorvactl(root_ + " set-data-protection" + container).status, 2) << "--protection-class is required";
  EXPECT_EQ(quorvactl(root_ + " set-data-protection" + container + " --protection-class 2").status, 1);
  EXPECT_EQ(quorvactl(root_ + " set-data-protection" + container + " --protection-class 4 --third-party").status, 1);
  ToolRun set = quorvactl(root_ + " --json set-data-protection" + container + " --protection-class 4 --retry-if-locked");
  EXPECT_EQ(set.status, 0) << set.out;
  EXPECT_NE(set.out.find("\"ReplyError\": 1"), std::string::npos) << set.out;

  ToolRun info = quorvactl(root_ + " --json info-get" + container + " --uuid " + jsonString(created.out, "ReplyUUID") +
                           " --key com.kelva.Verdane.ContentProtectionClass");
  EXPECT_EQ(info.status, 0) << info.out;
  EXPECT_NE(info.out.find("\"ReplyInfoValue\": 4"), std::string::npos) << info.out;
}

}  // namespace

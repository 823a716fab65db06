// Application groups through the running daemon: the installer hands over
// the code signing of two applications that share a group, each application
// (its own process, known to the daemon by its executable) asks for its
// groups, and the group lives exactly as long as one of them claims it.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <fstream>

#include "client/QRVContainerClient.h"
#include "integration/QRVRunAs.h"
#include "support/QRVDaemonTest.h"

namespace fs = std::filesystem;

namespace {

constexpr uid_t kInstallerUID = 2301;
constexpr uid_t kMobileUID = 501;
constexpr const char* kGroup = "group.example.shared";
constexpr const char* kToolGroup = "group.example.tool";

QRVPlist claimingTheGroup(const char* group = kGroup) {
  QRVPlist entitlements =
      QRVPlist::dictionary().set("com.kelva.security.application-groups", QRVPlist::array({QRVPlist::string(group)}));
  return QRVPlist::dictionary().set("com.kelva.Quorva.Entitlements", std::move(entitlements));
}

class GroupsIntegrationTest : public QRVDaemonTest {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root: clients run under other uids";
    // The two applications are copies of the command-line client: the trust
    // store tells them apart by executable, as it would two installed apps.
    for (const char* app : {"mail", "notes"}) {
      std::string copy = daemon_.root() + "/apps/" + app;
      fs::create_directories(fs::path(copy).parent_path());
      fs::copy_file(QUORVACTL_BINARY, copy, fs::copy_options::overwrite_existing);
      chmod(copy.c_str(), 0755);
      daemon_.trustEntry(app, QRVPlist::dictionary()
                                  .set("SigningIdentifier", QRVPlist::string(std::string("com.example.") + app))
                                  .set("Executable", QRVPlist::string(copy))
                                  .set("Entitlements", QRVPlist::dictionary()));
    }
    // A tool that is not installed by the installer: its groups are what its
    // own entitlements claim, registered by the daemon when it calls.
    std::string tool = daemon_.root() + "/apps/tool";
    fs::copy_file(QUORVACTL_BINARY, tool, fs::copy_options::overwrite_existing);
    chmod(tool.c_str(), 0755);
    daemon_.trustEntry("tool",
                       QRVPlist::dictionary()
                           .set("SigningIdentifier", QRVPlist::string("com.example.tool"))
                           .set("Executable", QRVPlist::string(tool))
                           .set("Entitlements", *claimingTheGroup(kToolGroup).get("com.kelva.Quorva.Entitlements")));
    startDaemon({{kInstallerUID, "com.example.installer", QRVEntitlements({"allowed"})}});
  }

  // The installer's command 18 for `identifier`, from its own process, through
  // the client library: the code, or 0 when no answer came.
  uint64_t install(const std::string& identifier, std::optional<QRVPlist> info) {
    std::string root = daemon_.root();
    auto answer = QRVRunAs(kInstallerUID, kInstallerUID, [&] {
      QRVClientError error;
      auto client = QRVClient::connect(root, &error);
      if (!client) return std::string("0");
      QRVContainerClient containers(std::move(*client));
      auto result = containers.processCodeSigningInfo(identifier, info, std::nullopt, &error);
      return std::to_string(result ? result->code : 0);
    });
    return answer ? std::stoull(*answer) : 0;
  }

  // What the application `app`, running as the mobile user, is told its
  // shared group's path is; "" when it got none.
  std::string groupPathSeenBy(const std::string& app, const char* group = kGroup) {
    std::string line =
        daemon_.root() + "/apps/" + app + " --root " + daemon_.root() + " --json group-lookup --class 7 2>/dev/null";
    auto out = QRVRunAs(kMobileUID, kMobileUID, [&] {
      std::string text;
      FILE* pipe = popen(line.c_str(), "r");
      if (!pipe) return text;
      char buffer[4096];
      for (size_t n; (n = fread(buffer, 1, sizeof buffer, pipe)) > 0;) text.append(buffer, n);
      pclose(pipe);
      return text;
    });
    if (!out) return {};
    const std::string key = std::string("\"") + group + "\": \"";
    size_t at = out->find(key);
    if (at == std::string::npos || out->find("\"ReplyError\": 1") == std::string::npos) return {};
    at += key.size();
    return out->substr(at, out->find('"', at) - at);
  }

  std::string deathRow() const { return daemon_.root() + "/private/var/root/Library/Caches/com.kelva.quorvad/Dead"; }
};

}  // namespace

TEST_F(GroupsIntegrationTest, TwoApplicationsShareTheirGroupUntilTheLastIsRemoved) {
  ASSERT_EQ(install("com.example.mail", claimingTheGroup()), 1u);
  ASSERT_EQ(install("com.example.notes", claimingTheGroup()), 1u);

  const std::string mailPath = groupPathSeenBy("mail");
  ASSERT_FALSE(mailPath.empty()) << daemon_.readLog();
  EXPECT_TRUE(fs::is_directory(mailPath));
  EXPECT_EQ(mailPath.rfind(daemon_.root() + "/private/var/mobile/Containers/", 0), 0u) << mailPath;
  EXPECT_EQ(groupPathSeenBy("notes"), mailPath);

  // Mail goes; notes still claims the group, which stays where it was.
  ASSERT_EQ(install("com.example.mail", std::nullopt), 1u);
  EXPECT_TRUE(fs::is_directory(mailPath));
  EXPECT_EQ(groupPathSeenBy("notes"), mailPath);
  EXPECT_EQ(groupPathSeenBy("mail"), "");  // nothing claimed any more

  // Notes goes too: the group has no claimant and is taken out of service
  // before the installer's reply.
  ASSERT_EQ(install("com.example.notes", std::nullopt), 1u);
  EXPECT_FALSE(fs::exists(mailPath));
  const std::string onDeathRow = deathRow() + "/" + fs::path(mailPath).filename().string();
  // Staging for deletion only moves it; death row is emptied on request.
  EXPECT_TRUE(fs::is_directory(onDeathRow)) << daemon_.readLog();
}

TEST_F(GroupsIntegrationTest, ACallersOwnEntitlementsCountUntilTheInstallerSpeaksForIt) {
  // Never installed: the tool's trust-store entitlements are registered as
  // it calls, and its group follows from them.
  const std::string toolPath = groupPathSeenBy("tool", kToolGroup);
  ASSERT_FALSE(toolPath.empty()) << daemon_.readLog();
  EXPECT_TRUE(fs::is_directory(toolPath));

  // Once the installer has handed over the tool's code signing (claiming the
  // shared group instead), the tool's own registration no longer overrides it.
  ASSERT_EQ(install("com.example.tool", claimingTheGroup()), 1u);
  EXPECT_FALSE(groupPathSeenBy("tool", kGroup).empty()) << daemon_.readLog();
  EXPECT_EQ(groupPathSeenBy("tool", kToolGroup), "");
}

namespace {

// A code-signing database that is not a database at all: the daemon must go
// on serving containers, answer the requests that need the database with a
// clear code, and use the database once it can be opened.
class DamagedDatabaseIntegrationTest : public GroupsIntegrationTest {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root: clients run under other uids";
    fs::create_directories(fs::path(database()).parent_path());
    std::ofstream(database()) << std::string(8192, '\x5a');
    GroupsIntegrationTest::SetUp();
  }
  std::string database() const { return daemon_.root() + "/private/var/root/Library/Quorva/containers.sqlite3"; }
};

}  // namespace

TEST_F(DamagedDatabaseIntegrationTest, ContainersAreStillServedAndTheDatabaseIsUsedOnceItOpens) {
  EXPECT_EQ(install("com.example.mail", claimingTheGroup()), 66u) << daemon_.readLog();
  // Containers do not depend on the database: the application gets its own
  // data container, and asking for its groups is an answer, not a failure.
  const std::string line = daemon_.root() + "/apps/mail --root " + daemon_.root() +
                           " --json lookup --id com.example.mail --class 2 --create 2>/dev/null";
  auto out = QRVRunAs(kMobileUID, kMobileUID, [&] {
    std::string text;
    if (FILE* pipe = popen(line.c_str(), "r")) {
      char buffer[4096];
      for (size_t n; (n = fread(buffer, 1, sizeof buffer, pipe)) > 0;) text.append(buffer, n);
      pclose(pipe);
    }
    return text;
  });
  ASSERT_TRUE(out.has_value());
  EXPECT_NE(out->find("\"ReplyError\": 1"), std::string::npos) << *out << daemon_.readLog();
  EXPECT_NE(daemon_.readLog().find("Failed to initialize database."), std::string::npos);

  // The damaged file is taken away (as an operator would): the next request
  // that needs the database opens a fresh one.
  fs::remove(database());
  ASSERT_EQ(install("com.example.mail", claimingTheGroup()), 1u) << daemon_.readLog();
  EXPECT_FALSE(groupPathSeenBy("mail").empty()) << daemon_.readLog();
}

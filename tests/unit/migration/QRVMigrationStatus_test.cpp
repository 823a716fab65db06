#include "migration/QRVMigrationStatus.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <string>

#include "fs/QRVDictionaryAdditions.h"
#include "platform/linux/QRVLinuxSystemInfo.h"
#include "support/QRVFiles.h"
#include "support/QRVTestServices.h"

namespace {

using testing::HasSubstr;
using Op = QRVFaultInjectionFileSystem::Operation;

const char* const kMarkerFiles[] = {"qrv_bundle_migration_complete.plist", "qrv_acl2_migration_complete.plist",
                                    "qrv_group_id_migration_complete.plist",
                                    "qrv_code_signing_migration_complete.plist"};

class MigrationStatusTest : public testing::Test {
 protected:
  QRVServices& services() { return *env_.services; }
  std::string library() { return env_.root.path() + "/private/var/root/Library/Quorva"; }
  std::string systemFile() { return library() + "/qrv_migration_status.plist"; }
  std::string userFile() {
    return env_.root.path() + "/private/var/mobile/Library/Quorva/qrv_user_migration_status.plist";
  }

  void writePlist(const std::string& path, const QRVPlist& plist) {
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    auto bytes = plist.toBinary();
    QRVWriteText(path, std::string(bytes.begin(), bytes.end()));
  }
  std::optional<QRVPlist> readPlist(const std::string& path) {
    std::string text = QRVReadText(path);
    return QRVPlist::fromBytes(reinterpret_cast<const uint8_t*>(text.data()), text.size());
  }
  // Reads the os-release file at `<root>/etc/os-release` from now on.
  void useOSRelease(const std::string& text) {
    std::filesystem::create_directories(env_.root.path() + "/etc");
    QRVWriteText(env_.root.path() + "/etc/os-release", text);
    services().platform.systemInfo = std::make_shared<QRVLinuxSystemInfo>(env_.root.path() + "/etc/os-release");
  }

  QRVTestServices env_;
};

TEST_F(MigrationStatusTest, FirstBootRecordsBuildAndMigrationsAcrossObjectsUntilTheBuildChanges) {
  auto system = QRVMigrationStatus::initForSystemMigration(services());
  ASSERT_NE(system, nullptr);
  EXPECT_TRUE(system->migrationInfo().isDictionary());
  EXPECT_TRUE(system->migrationInfo().dictionaryValue().empty());
  EXPECT_FALSE(system->hasMigrationOccurredForType(QRVMigrationStatus::kBundleMigration));
  testing::internal::CaptureStderr();
  EXPECT_TRUE(system->isBuildUpgrade());
  EXPECT_THAT(testing::internal::GetCapturedStderr(),
              HasSubstr("Did not find last build info; we must be upgrading from pre-9.3.1 or this is an erase "
                        "install."));

  ASSERT_TRUE(system->writeCurrentBuildInfoToDisk());
  ASSERT_TRUE(system->setMigrationCompleteForType(QRVMigrationStatus::kSubdirectoryMigration));
  // The same build on the next boot, with a fresh object reading the disk.
  auto again = QRVMigrationStatus::initForSystemMigration(services());
  ASSERT_NE(again, nullptr);
  testing::internal::CaptureStderr();
  EXPECT_FALSE(again->isBuildUpgrade());
  EXPECT_THAT(testing::internal::GetCapturedStderr(),
              HasSubstr("Current build version (1A1 / (null)) equal to last version recorded (1A1 / (null)); "
                        "skipping upgrade"));
  EXPECT_TRUE(again->hasMigrationOccurredForType(QRVMigrationStatus::kSubdirectoryMigration));
  EXPECT_FALSE(again->hasMigrationOccurredForType(QRVMigrationStatus::kACLMigration));
  const QRVPlist* done = again->migrationInfo().get(QRVMigrationStatus::kSubdirectoryMigration);
  ASSERT_NE(done, nullptr);
  EXPECT_EQ(done->stringForKey("QRVMigrationVersionNumber"), "1A1");
  EXPECT_THAT(done->stringForKey("QRVMigrationTime"), testing::MatchesRegex("20[0-9-]+ [0-9:]+ \\+0000"));
  // A binary property list, as every status file is.
  EXPECT_EQ(QRVReadText(systemFile()).substr(0, 8), "bplist00");

  env_.systemInfo->build = "2B2";
  testing::internal::CaptureStderr();
  EXPECT_TRUE(again->isBuildUpgrade());
  EXPECT_THAT(testing::internal::GetCapturedStderr(), HasSubstr("Detected upgrade from 1A1 ((null)) to 2B2 ((null))"));

  // The user's status is a file of its own in the default user's library.
  auto user = QRVMigrationStatus::initForMobileUserMigration(services());
  ASSERT_NE(user, nullptr);
  EXPECT_FALSE(user->hasMigrationOccurredForType(QRVMigrationStatus::kSubdirectoryMigration));
  ASSERT_TRUE(user->setMigrationCompleteForType(QRVMigrationStatus::kACLMigration));
  ASSERT_TRUE(readPlist(userFile()));
  EXPECT_NE(readPlist(userFile())->get(QRVMigrationStatus::kACLMigration), nullptr);
  EXPECT_EQ(readPlist(systemFile())->get(QRVMigrationStatus::kACLMigration), nullptr);
}

TEST_F(MigrationStatusTest, MarkersAreFoldedAndRemovedOnlyOnceTheStatusFileIsWritten) {
  std::filesystem::create_directories(library());
  for (int i = 0; i < 3; i++)
    writePlist(library() + "/" + kMarkerFiles[i], QRVPlist::dictionary().set("Marker", QRVPlist::uinteger(i)));
  QRVWriteText(library() + "/" + kMarkerFiles[3], "not a property list");

  // The status file cannot be put in place: nothing is lost, the markers stay.
  env_.posixFileSystem->failNext(Op::kRename, ENOSPC, "qrv_migration_status");
  testing::internal::CaptureStderr();
  auto failed = QRVMigrationStatus::initForSystemMigration(services());
  std::string log = testing::internal::GetCapturedStderr();
  ASSERT_NE(failed, nullptr);
  EXPECT_THAT(log, HasSubstr("Migrating from many marker files down to one"));
  EXPECT_THAT(log, HasSubstr("Failed to read migration marker file at " + library() + "/" + kMarkerFiles[3]));
  EXPECT_THAT(log, HasSubstr("Failed to write migration status on " + systemFile()));
  EXPECT_TRUE(failed->hasMigrationOccurredForType(QRVMigrationStatus::kBundleMigration));
  EXPECT_FALSE(std::filesystem::exists(systemFile()));
  for (const char* marker : kMarkerFiles) EXPECT_TRUE(std::filesystem::exists(library() + "/" + marker)) << marker;
  // Neither the temporary file nor anything else is left beside them.
  EXPECT_EQ(QRVEntriesIn(library()), 4u);

  // Next boot the write succeeds: the readable markers become entries and
  // every marker goes.
  auto folded = QRVMigrationStatus::initForSystemMigration(services());
  ASSERT_NE(folded, nullptr);
  auto onDisk = readPlist(systemFile());
  ASSERT_TRUE(onDisk);
  EXPECT_EQ(onDisk->get(QRVMigrationStatus::kBundleMigration)->uint64ForKey("Marker"), 0u);
  EXPECT_EQ(onDisk->get(QRVMigrationStatus::kACLMigration)->uint64ForKey("Marker"), 1u);
  EXPECT_EQ(onDisk->get(QRVMigrationStatus::kGroupIdMigration)->uint64ForKey("Marker"), 2u);
  EXPECT_EQ(onDisk->get(QRVMigrationStatus::kCodeSigningMigration), nullptr);
  for (const char* marker : kMarkerFiles) EXPECT_FALSE(std::filesystem::exists(library() + "/" + marker)) << marker;

  // Markers appearing beside a status file that already holds something are
  // not the status's business any more.
  writePlist(library() + "/" + kMarkerFiles[3], QRVPlist::dictionary());
  auto later = QRVMigrationStatus::initForSystemMigration(services());
  ASSERT_NE(later, nullptr);
  EXPECT_FALSE(later->hasMigrationOccurredForType(QRVMigrationStatus::kCodeSigningMigration));
  EXPECT_TRUE(std::filesystem::exists(library() + "/" + kMarkerFiles[3]));
}

TEST_F(MigrationStatusTest, AnUnreadableStatusFileGivesNoObject) {
  struct Case {
    const char* name;
    std::function<void(const std::string&)> plant;
  };
  const Case cases[] = {
      {"not a property list", [](const std::string& p) { QRVWriteText(p, "garbage\x01\x02"); }},
      {"truncated binary list",
       [](const std::string& p) {
         auto bytes = QRVPlist::dictionary().set("LastBuildInfo", QRVPlist::dictionary()).toBinary();
         QRVWriteText(p, std::string(bytes.begin(), bytes.begin() + bytes.size() / 2));
       }},
      {"an array", [this](const std::string& p) { writePlist(p, QRVPlist::array({QRVPlist::string("x")})); }},
      {"a link to a valid file elsewhere",
       [this](const std::string& p) {
         writePlist(env_.root.path() + "/elsewhere.plist", QRVPlist::dictionary().set("X", QRVPlist::string("y")));
         std::filesystem::create_symlink(env_.root.path() + "/elsewhere.plist", p);
       }},
      {"a directory", [](const std::string& p) { std::filesystem::create_directories(p); }},
  };
  for (const Case& c : cases) {
    for (bool isUser : {false, true}) {
      std::string path = isUser ? userFile() : systemFile();
      std::filesystem::create_directories(std::filesystem::path(path).parent_path());
      std::filesystem::remove_all(path);
      c.plant(path);
      testing::internal::CaptureStderr();
      auto status = isUser ? QRVMigrationStatus::initForMobileUserMigration(services())
                           : QRVMigrationStatus::initForSystemMigration(services());
      std::string log = testing::internal::GetCapturedStderr();
      EXPECT_EQ(status, nullptr) << c.name;
      EXPECT_THAT(log, HasSubstr("Failed to read migration status file at " + path + " : ")) << c.name;
      EXPECT_THAT(log, HasSubstr(isUser ? "Error reading user migration file from disk.  This is bad"
                                        : "Error reading system migration file from disk.  This is bad"))
          << c.name;
      std::filesystem::remove_all(path);
    }
  }
}

TEST_F(MigrationStatusTest, ABuildThatCannotBeReadCountsAsAnUpgrade) {
  useOSRelease("NAME=\"Kelva OS\"\nBUILD_ID=42A\nVARIANT_ID=internal\n");
  auto status = QRVMigrationStatus::initForSystemMigration(services());
  ASSERT_NE(status, nullptr);
  ASSERT_TRUE(status->writeCurrentBuildInfoToDisk());
  const QRVPlist* last = status->migrationInfo().get("LastBuildInfo");
  ASSERT_NE(last, nullptr);
  EXPECT_EQ(last->stringForKey("BUILD_ID"), "42A");
  EXPECT_EQ(last->stringForKey("ReleaseType"), "internal");
  EXPECT_EQ(last->stringForKey("NAME"), "Kelva OS");
  testing::internal::CaptureStderr();
  EXPECT_FALSE(status->isBuildUpgrade());
  EXPECT_THAT(testing::internal::GetCapturedStderr(),
              HasSubstr("Current build version (42A / internal) equal to last version recorded (42A / internal)"));

  // The release file lost its build: the build is "Unknown" and nothing can
  // be compared.
  useOSRelease("NAME=\"Kelva OS\"\nVARIANT_ID=internal\n");
  EXPECT_EQ(QRVMigrationStatus::currentBuildVersion(services()), "Unknown");
  testing::internal::CaptureStderr();
  EXPECT_TRUE(status->isBuildUpgrade());
  EXPECT_THAT(testing::internal::GetCapturedStderr(),
              HasSubstr("Could not get current build string; assuming this is an upgrade"));
  ASSERT_TRUE(status->setMigrationCompleteForType(QRVMigrationStatus::kGroupIdMigration));
  EXPECT_EQ(
      status->migrationInfo().get(QRVMigrationStatus::kGroupIdMigration)->stringForKey("QRVMigrationVersionNumber"),
      "Unknown");

  // Saved without a build, the record cannot be compared on the next boot.
  ASSERT_TRUE(status->writeCurrentBuildInfoToDisk());
  useOSRelease("BUILD_ID=43B\n");
  auto next = QRVMigrationStatus::initForSystemMigration(services());
  ASSERT_NE(next, nullptr);
  testing::internal::CaptureStderr();
  EXPECT_TRUE(next->isBuildUpgrade());
  EXPECT_THAT(testing::internal::GetCapturedStderr(),
              HasSubstr("Could not get build version from last build info dictionary; assuming this is an upgrade"));

  // No release file at all.
  ASSERT_TRUE(next->writeCurrentBuildInfoToDisk());
  std::filesystem::remove(env_.root.path() + "/etc/os-release");
  services().platform.systemInfo = std::make_shared<QRVLinuxSystemInfo>(env_.root.path() + "/etc/os-release");
  testing::internal::CaptureStderr();
  EXPECT_TRUE(next->isBuildUpgrade());
  EXPECT_THAT(testing::internal::GetCapturedStderr(),
              HasSubstr("Could not get current build info; assuming this is an upgrade"));
  EXPECT_EQ(QRVMigrationStatus::currentBuildVersion(services()), "Unknown");
}

}  // namespace

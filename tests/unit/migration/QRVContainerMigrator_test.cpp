// The one-time migrations of an older layout: what each step moves or
// fixes, that a recorded step never runs again while a failed one does, and
// that the user-owned places they read from cannot point the daemon
// elsewhere.
#include <gtest/gtest.h>

#include <acl/libacl.h>
#include <sys/acl.h>
#include <sys/stat.h>

#include <filesystem>

#include "dataprotection/QRVDataProtectionManager.h"
#include "migration/QRVContainerMigrator.h"
#include "migration/QRVMigrationStatus.h"
#include "support/QRVContainerTest.h"
#include "support/QRVLogCapture.h"

namespace fs = std::filesystem;
using Fault = QRVFaultInjectionFileSystem;

namespace {

class ContainerMigratorTest : public QRVContainerTest {
 protected:
  QRVContainerMigrator& migrator() { return *env_.services->containerMigrator; }
  std::string under(const std::string& path) { return env_.root.path() + path; }
  std::string oldLogs() { return under("/private/var/mobile/Library/Logs/Quorva"); }
  std::string newLogs() { return under("/private/var/root/Library/Logs/Quorva"); }
  std::string oldBundles() { return under(QRVContainerMigrator::kOldBundleContainersPath); }

  bool upgrade(QRVError* error = nullptr) {
    std::unique_ptr<QRVMigrationStatus> status = QRVMigrationStatus::initForSystemMigration(*env_.services);
    EXPECT_NE(status, nullptr);
    QRVError ignored;
    return migrator().performSynchronousBuildUpgradeMigration(*status, error ? error : &ignored);
  }
  bool recorded(const char* type, bool user = false) {
    auto status = user ? QRVMigrationStatus::initForMobileUserMigration(*env_.services)
                       : QRVMigrationStatus::initForSystemMigration(*env_.services);
    return status && status->hasMigrationOccurredForType(type);
  }
  void dataMigration() {
    QRVError error;
    EXPECT_TRUE(migrator().performDataMigratorMigrationForClientConnection(*admin(), &error)) << error.description();
  }
  void perUserMigration() {
    QRVError error;
    EXPECT_TRUE(migrator().performPerUserDataMigrationForClientConnection(*admin(), &error)) << error.description();
  }
  // Installs `identifier` with entitlements asking for a protection class.
  void install(const std::string& identifier, const std::string& protectionClass) {
    QRVPlist entitlements = QRVPlist::dictionary().set(QRVDataProtectionManager::kDataProtectionClassEntitlement,
                                                       QRVPlist::string(protectionClass));
    QRVCommandQueue queue;
    ASSERT_EQ(env_.services->codeSigningMapping->processCodeSigningInfo(
                  QRVPlist::dictionary().set(kQRVCodeSigningEntitlementsKey, entitlements), identifier, QRVPlist(),
                  queue),
              1u);
    uint64_t result = 1;
    ASSERT_TRUE(queue.executeAllUntilExhaustedOrError(&result));
  }
};

uid_t ownerOf(const std::string& path) {
  struct stat st{};
  EXPECT_EQ(lstat(path.c_str(), &st), 0) << path;
  return st.st_uid;
}

// Whether `path` carries more than the three entries its mode implies.
bool hasExtendedACL(const std::string& path) { return acl_extended_file_nofollow(path.c_str()) == 1; }

void dropACL(const std::string& path) {
  struct stat st{};
  ASSERT_EQ(lstat(path.c_str(), &st), 0);
  acl_t plain = acl_from_mode(st.st_mode);
  ASSERT_EQ(acl_set_file(path.c_str(), ACL_TYPE_ACCESS, plain), 0);
  acl_free(plain);
  acl_delete_def_file(path.c_str());
}

}  // namespace

// The old log files are renumbered one older, as many as the writer keeps;
// names without a number count as the current file; the rest go with the
// old directory, whatever happens to single moves.
TEST_F(ContainerMigratorTest, OldLogFilesAreRenumberedUpToTheRotationCountAndTheOldDirectoryGoes) {
  for (const char* name : {"quorvad.log", "quorvad.log.0", "quorvad.log.1", "quorvad.log.3", "notes", "odd.x1"})
    file(oldLogs() + "/" + name);
  env_.services->globalConfiguration->setIsInternalImage(true);
  env_.posixFileSystem->failNext(Fault::Operation::kRename, EIO, "odd.x1");
  QRVLogCapture log(env_.root.path());
  ASSERT_TRUE(upgrade());

  // Four kept on an internal image: numbers 0..3 become 1..4. The current
  // file and "notes" both become number 1 of their own name.
  EXPECT_TRUE(fs::exists(newLogs() + "/quorvad.1"));
  EXPECT_TRUE(fs::exists(newLogs() + "/quorvad.log.1"));
  EXPECT_TRUE(fs::exists(newLogs() + "/quorvad.log.2"));
  EXPECT_TRUE(fs::exists(newLogs() + "/quorvad.log.4"));
  EXPECT_TRUE(fs::exists(newLogs() + "/notes.1"));
  EXPECT_FALSE(fs::exists(newLogs() + "/odd.1"));
  EXPECT_FALSE(fs::exists(oldLogs())) << "removed even though one move failed";
  EXPECT_NE(log.text().find("Failed to move to new logging directory from " + oldLogs() + "/odd.x1"),
            std::string::npos);
  EXPECT_NE(log.text().find("Migrated log files on"), std::string::npos);

  // One kept otherwise: number 1 is already too old.
  env_.services->globalConfiguration->setIsInternalImage(false);
  for (const char* name : {"quorvad.log", "quorvad.log.1"}) file(oldLogs() + "/again-" + name);
  ASSERT_TRUE(upgrade());
  EXPECT_TRUE(fs::exists(newLogs() + "/again-quorvad.1"));
  EXPECT_FALSE(fs::exists(newLogs() + "/again-quorvad.log.2"));
  EXPECT_FALSE(fs::exists(oldLogs()));

  // A multi-user host never logged into a user's home: nothing is touched.
  file(oldLogs() + "/quorvad.log.0");
  env_.personas->flags = QRVPersonaService::kMultiUserHostBit;
  ASSERT_TRUE(upgrade());
  EXPECT_TRUE(fs::exists(oldLogs() + "/quorvad.log.0"));
}

// The user owns the old log directory's path: a link in it must not make
// the daemon move (and then remove) a directory of its own.
TEST_F(ContainerMigratorTest, ALinkInTheOldLogPathIsNotFollowed) {
  const std::string library = under("/private/var/root/Library/Quorva");
  file(library + "/precious");
  fs::create_directories(under("/private/var/mobile/Library/Logs"));
  fs::create_symlink(library, oldLogs());
  ASSERT_TRUE(upgrade());
  EXPECT_TRUE(fs::exists(library + "/precious"));
  EXPECT_FALSE(fs::exists(newLogs() + "/precious.1"));
}

TEST_F(ContainerMigratorTest, TheOldBundleTreeMovesWholeOrTheUpgradeStopsWithNothingLost) {
  // What the daemon makes in the bundle directory by itself makes way.
  ASSERT_TRUE(env_.services->globalConfiguration->containerDirectoryURLForUserIdentity(
      env_.services->userIdentityCache->defaultUserIdentity(), QRVContainerClassAppBundle, false));
  file(oldBundles() + "/Application/B1/App.app/binary");
  ASSERT_TRUE(upgrade());
  const std::string bundles = env_.services->globalConfiguration->bundleDirectory();
  EXPECT_TRUE(fs::exists(bundles + "/Application/B1/App.app/binary"));
  EXPECT_FALSE(fs::exists(oldBundles()));
  EXPECT_TRUE(recorded(QRVMigrationStatus::kACLMigration)) << "no system containers: no ACLs to migrate";

  // A bundle directory that holds bundles already cannot take the old tree:
  // the upgrade stops before the later steps, and both trees stay whole.
  fs::remove_all(under("/private/var/root/Library/Quorva/qrv_migration_status.plist"));
  file(oldBundles() + "/Application/B2/App.app/binary");
  QRVLogCapture log(env_.root.path());
  QRVError error;
  EXPECT_FALSE(upgrade(&error));
  EXPECT_NE(log.text().find("Failed to migrate to new bundle containers location : "), std::string::npos);
  EXPECT_NE(log.text().find(".  This is terrible."), std::string::npos);
  EXPECT_TRUE(fs::exists(oldBundles() + "/Application/B2/App.app/binary"));
  EXPECT_TRUE(fs::exists(bundles + "/Application/B1/App.app/binary"));

  // Through the boot set-up, the failure is only logged and the build still
  // recorded: the next boot on this build does not try again.
  env_.systemInfo->build = "2B100";
  admin()->rebootQuorvaSetup();
  EXPECT_NE(log.text().find("Failed to perform build upgrade migration : "), std::string::npos);
  std::unique_ptr<QRVMigrationStatus> status = QRVMigrationStatus::initForSystemMigration(*env_.services);
  EXPECT_FALSE(status->isBuildUpgrade());

  // A link to elsewhere in the old place is not the daemon's tree.
  fs::remove_all(oldBundles());
  const std::string elsewhere = under("/private/var/root/Library/Quorva");
  fs::create_symlink(elsewhere, oldBundles());
  EXPECT_TRUE(upgrade());
  EXPECT_TRUE(fs::is_symlink(oldBundles()));
  EXPECT_TRUE(fs::exists(elsewhere));
}

// The ACL step of the data migrator: only once, and again after a failure.
TEST_F(ContainerMigratorTest, SystemContainerACLsAreStandardisedOnceAndAgainAfterAFailure) {
  QRVMetadataRef system = create(identity("com.example.sys", QRVContainerClassSystemData));
  QRVMetadataRef group = create(identity("systemgroup.com.example.g", QRVContainerClassSystemGroup));
  ASSERT_TRUE(system && group);
  if (!hasExtendedACL(system->url())) GTEST_SKIP() << "this file system has no POSIX ACLs";
  ASSERT_TRUE(upgrade());
  EXPECT_FALSE(recorded(QRVMigrationStatus::kACLMigration)) << "system containers exist: the ACLs need a look";

  dropACL(system->url());
  dropACL(group->url());
  env_.posixFileSystem->failNext(Fault::Operation::kOpen, EIO, "SystemGroup");
  dataMigration();
  EXPECT_FALSE(recorded(QRVMigrationStatus::kACLMigration)) << "the group half failed";
  EXPECT_TRUE(hasExtendedACL(system->url())) << "the other half still ran";

  dataMigration();
  EXPECT_TRUE(hasExtendedACL(group->url()));
  EXPECT_TRUE(recorded(QRVMigrationStatus::kACLMigration));

  dropACL(system->url());
  dataMigration();
  EXPECT_FALSE(hasExtendedACL(system->url())) << "recorded: never again";
}

TEST_F(ContainerMigratorTest, TheBundleTreeIsHandedToTheInstallerOnce) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to change owners";
  QRVMetadataRef bundle = create(identity("com.example.app", QRVContainerClassAppBundle));
  ASSERT_NE(bundle, nullptr);
  const std::string binary = bundle->url() + "/App.app/binary";
  file(binary);
  ASSERT_EQ(lchown(binary.c_str(), 501, 501), 0);
  dataMigration();
  EXPECT_EQ(ownerOf(binary), CONTAINER_INSTALLATION_UID);
  EXPECT_TRUE(recorded(QRVMigrationStatus::kBundleMigration));

  ASSERT_EQ(lchown(binary.c_str(), 501, 501), 0);
  dataMigration();
  EXPECT_EQ(ownerOf(binary), 501u) << "recorded: never again";
}

// Subdirectories of every user's containers are made once; the protection
// class of a data container without an application follows its
// entitlements every time, while an application's is the installer's.
TEST_F(ContainerMigratorTest, PerUserMigrationMakesSubdirectoriesOnceAndClassesOfContainersWithoutAnApp) {
  env_.personas->supported = true;
  env_.personas->list = {{1000, 501, 501, QRVPersonaTypePersonal, "PERSONAL", "/private/var/mobile", {}, false, false},
                         {1001, 501, 501, QRVPersonaTypeEnterprise, "WORK", "/private/var/work", {}, false, false}};
  fs::create_directories(under("/private/var/work"));
  env_.services->userIdentityCache->flush();
  QRVUserIdentityRef personal = env_.services->userIdentityCache->userIdentityForPersonalPersona();
  QRVUserIdentityRef work = env_.services->userIdentityCache->userIdentityWithPersonaID(1001);
  ASSERT_TRUE(personal && work);

  QRVMetadataRef personalData = create(identity("com.example.app", QRVContainerClassAppData, personal));
  QRVMetadataRef workPlugin = create(identity("com.example.plugin", QRVContainerClassPluginData, work));
  QRVMetadataRef workGroup = create(identity("group.com.example", QRVContainerClassAppGroup, work));
  QRVMetadataRef appBundle = create(identity("com.example.app", QRVContainerClassAppBundle));
  ASSERT_TRUE(personalData && workPlugin && workGroup && appBundle);
  for (const QRVMetadataRef& m : {personalData, workPlugin}) fs::remove_all(m->url() + "/Library/Caches");
  fs::remove_all(workGroup->url() + "/Library/Preferences");

  for (const char* id : {"com.example.app", "com.example.plugin"}) install(id, "KLFileProtectionComplete");
  setClass(personalData->url(), 3);
  setClass(workPlugin->url(), 3);
  file(workPlugin->url() + "/Documents/kept", 3);

  QRVLogCapture log(env_.root.path());
  perUserMigration();
  EXPECT_TRUE(fs::is_directory(personalData->url() + "/Library/Caches"));
  EXPECT_TRUE(fs::is_directory(workPlugin->url() + "/Library/Caches"));
  EXPECT_TRUE(fs::is_directory(workGroup->url() + "/Library/Preferences"));
  EXPECT_TRUE(recorded(QRVMigrationStatus::kSubdirectoryMigration, /*user=*/true));
  EXPECT_NE(log.text().find("Completed Per User Subdirectory Migration for "), std::string::npos);
  EXPECT_EQ(log.text().find("Success: N"), std::string::npos) << log.text();

  EXPECT_EQ(classOf(personalData->url()), 3u) << "an installed application's class is the installer's";
  EXPECT_EQ(classOf(workPlugin->url() + "/Documents/kept"), 1u) << "a plug-in without an app follows entitlements";

  // The plug-in's entitlements change with an update.
  fs::remove_all(personalData->url() + "/Library/Caches");
  install("com.example.plugin", "KLFileProtectionNone");
  perUserMigration();
  EXPECT_FALSE(fs::exists(personalData->url() + "/Library/Caches")) << "subdirectories: recorded, never again";
  // Towards a weaker class only directories change: new files follow them.
  EXPECT_EQ(classOf(workPlugin->url() + "/Documents"), 4u) << "classes: every time";
}

TEST_F(ContainerMigratorTest, AFailedSubdirectoryMigrationIsNotRecordedAndRunsAgain) {
  QRVMetadataRef data = create(identity("com.example.app"));
  ASSERT_NE(data, nullptr);
  fs::remove_all(data->url() + "/tmp");
  // A file where a default subdirectory belongs: the directory cannot be
  // made until someone removes it.
  fs::remove_all(data->url() + "/tmp");
  file(data->url() + "/tmp");
  QRVLogCapture log(env_.root.path());
  perUserMigration();
  EXPECT_NE(log.text().find("Success: N"), std::string::npos);
  EXPECT_FALSE(recorded(QRVMigrationStatus::kSubdirectoryMigration, /*user=*/true));
  fs::remove(data->url() + "/tmp");
  perUserMigration();
  EXPECT_TRUE(fs::is_directory(data->url() + "/tmp"));
  EXPECT_TRUE(recorded(QRVMigrationStatus::kSubdirectoryMigration, /*user=*/true));
}

#include "core/QRVBundleExecutable.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>

#include "codesigning/QRVCodeSigningMapping.h"
#include "core/QRVClientIdentity.h"
#include "core/QRVCommandQueue.h"
#include "platform/linux/QRVLinuxTrustStore.h"
#include "platform/linux/QRVProcInfo.h"
#include "support/QRVContainerTest.h"
#include "support/QRVEventually.h"
#include "support/QRVTestConnection.h"

namespace fs = std::filesystem;

namespace {

// A copy of a real program, started from `path` and killed at the end.
class RunningProgram {
 public:
  explicit RunningProgram(const std::string& path) : path_(path) {
    fs::create_directories(fs::path(path).parent_path());
    fs::copy_file("/bin/sleep", path, fs::copy_options::overwrite_existing);
    fs::permissions(path, fs::perms::owner_all | fs::perms::group_exec | fs::perms::others_exec);
    char* argv[] = {const_cast<char*>(path.c_str()), const_cast<char*>("30"), nullptr};
    if (posix_spawn(&pid_, path.c_str(), nullptr, nullptr, argv, environ) != 0) pid_ = -1;
    // Running once the kernel reports the new program.
    QRVEventually([&] { return pid_ > 0 && QRVProcInfo::executable(pid_) == fileId(path); });
  }
  ~RunningProgram() { stop(); }
  void stop() {
    if (pid_ <= 0) return;
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
    pid_ = -1;
  }
  pid_t pid() const { return pid_; }
  QRVAuditToken token() const {
    return QRVAuditToken::make(getuid(), getgid(), pid_, QRVProcInfo::startTime(pid_).value_or(0));
  }
  static std::optional<QRVProcInfo::FileId> fileId(const std::string& path) {
    struct stat st;
    if (stat(path.c_str(), &st) != 0) return std::nullopt;
    return QRVProcInfo::FileId{st.st_dev, st.st_ino};
  }

 private:
  std::string path_;
  pid_t pid_ = -1;
};

class BundleExecutableTest : public QRVContainerTest {
 protected:
  void SetUp() override {
    fs::create_directories(trustDirectory());
    store_ = std::make_shared<QRVLinuxTrustStore>(trustDirectory());
    env_.services->platform.trustStore = store_;
  }
  std::string trustDirectory() { return env_.root.path() + "/etc/quorva/clients.d"; }
  // `keepable` receives whether the identity may be kept between requests.
  std::shared_ptr<const QRVClientIdentity> identityOf(const RunningProgram& program, bool* keepable = nullptr) {
    QRVTestConnection connection(program.pid(), getuid(), getgid(), program.token().startTime());
    return QRVClientIdentity::clientIdentityWithRelayConnection(connection, *env_.services, keepable);
  }
  std::shared_ptr<QRVLinuxTrustStore> store_;
};

TEST_F(BundleExecutableTest, AProgramInsideABundleContainerIsThatContainer) {
  auto app = create(identity("com.example.bundled", QRVContainerClassAppBundle));
  auto plugin = create(identity("com.example.bundled.plugin", QRVContainerClassPluginBundle));
  ASSERT_TRUE(app && plugin);
  RunningProgram program(app->url() + "/Bundled.app/bundled");
  ASSERT_GT(program.pid(), 0);

  std::optional<std::string> path = store_->executablePathForUnlistedAuditToken(program.token());
  ASSERT_TRUE(path);
  EXPECT_EQ(*path, fs::canonical(app->url() + "/Bundled.app/bundled").string());
  auto owner = QRVBundleExecutable::ownerOfExecutablePath(*path, *env_.services);
  ASSERT_TRUE(owner);
  EXPECT_EQ(owner->identifier, "com.example.bundled");
  EXPECT_EQ(owner->containerClass, QRVContainerClassAppBundle);

  auto client = identityOf(program);
  ASSERT_NE(client, nullptr);
  EXPECT_EQ(client->bundleIdentifier(), "com.example.bundled");
  EXPECT_TRUE(client->entitlements().isDictionary());
  EXPECT_FALSE(client->boolValueOfEntitlement("com.example.flag"));
  // The entitlements are those the code-signing mapping holds for it.
  QRVCommandQueue queue;
  ASSERT_EQ(env_.services->codeSigningMapping->processCallerRegisteredEntitlements(
                QRVPlist::dictionary().set("com.example.flag", QRVPlist::boolean(true)), "com.example.bundled", queue),
            1u);
  // Which is why such an identity is never kept between requests.
  bool keepable = true;
  client = identityOf(program, &keepable);
  ASSERT_NE(client, nullptr);
  EXPECT_TRUE(client->boolValueOfEntitlement("com.example.flag"));
  EXPECT_FALSE(keepable);

  RunningProgram pluginProgram(plugin->url() + "/x");
  auto pluginOwner = QRVBundleExecutable::ownerOfExecutablePath(
      store_->executablePathForUnlistedAuditToken(pluginProgram.token()).value_or(""), *env_.services);
  ASSERT_TRUE(pluginOwner);
  EXPECT_EQ(pluginOwner->identifier, "com.example.bundled.plugin");

  // A trust-store entry for the same executable wins over the container.
  QRVWriteText(trustDirectory() + "/a.plist", QRVPlist::dictionary()
                                                  .set("SigningIdentifier", QRVPlist::string("com.example.listed"))
                                                  .set("Executable", QRVPlist::string(*path))
                                                  .toXML());
  EXPECT_EQ(store_->executablePathForUnlistedAuditToken(program.token()), std::nullopt);
  ASSERT_NE(identityOf(program, &keepable), nullptr);
  EXPECT_TRUE(keepable);
  EXPECT_EQ(identityOf(program)->bundleIdentifier(), "com.example.listed");

  // A process that is gone is nobody, even if its pid were reused.
  QRVAuditToken stale = pluginProgram.token();
  pluginProgram.stop();
  EXPECT_EQ(store_->executablePathForUnlistedAuditToken(stale), std::nullopt);
}

TEST_F(BundleExecutableTest, NothingOutsideAKnownContainerNamesAnyone) {
  auto app = create(identity("com.example.real", QRVContainerClassAppBundle));
  auto data = create(identity("com.example.real", QRVContainerClassAppData));
  ASSERT_TRUE(app && data);
  const std::string classDirectory = fs::path(app->url()).parent_path().string();

  // A stray directory beside the container, carrying a copy of its metadata.
  const std::string stray = classDirectory + "/00000000-0000-0000-0000-000000000001";
  fs::create_directories(stray);
  fs::copy_file(app->metadataFileURL(), stray + "/" + QRVMetadata::kFileName);
  RunningProgram strayProgram(stray + "/bin/tool");
  std::optional<std::string> strayPath = store_->executablePathForUnlistedAuditToken(strayProgram.token());
  ASSERT_TRUE(strayPath);
  EXPECT_EQ(QRVBundleExecutable::ownerOfExecutablePath(*strayPath, *env_.services), std::nullopt);
  auto strayClient = identityOf(strayProgram);
  EXPECT_EQ(strayClient, nullptr);

  // A data container is not a bundle: its programs are nobody.
  RunningProgram dataProgram(data->url() + "/Library/tool");
  EXPECT_EQ(QRVBundleExecutable::ownerOfExecutablePath(
                store_->executablePathForUnlistedAuditToken(dataProgram.token()).value_or(""), *env_.services),
            std::nullopt);

  // A link inside the container to a program elsewhere runs that program:
  // the kernel reports the real path, outside every container.
  const std::string outside = env_.root.path() + "/elsewhere/tool";
  RunningProgram outsideProgram(outside);
  outsideProgram.stop();
  fs::create_symlink(outside, app->url() + "/link");
  RunningProgram viaLink(app->url() + "/link");
  std::optional<std::string> linkedPath = store_->executablePathForUnlistedAuditToken(viaLink.token());
  ASSERT_TRUE(linkedPath);
  EXPECT_EQ(*linkedPath, fs::canonical(outside).string());
  EXPECT_EQ(QRVBundleExecutable::ownerOfExecutablePath(*linkedPath, *env_.services), std::nullopt);

  // A program replaced at its path after it started is not what lies there.
  RunningProgram replaced(app->url() + "/replaced");
  fs::copy_file("/bin/sleep", app->url() + "/other");
  fs::rename(app->url() + "/other", app->url() + "/replaced");
  EXPECT_EQ(store_->executablePathForUnlistedAuditToken(replaced.token()), std::nullopt);

  // Paths that are not what the kernel reports never match by prefix.
  for (const std::string& hostile :
       {app->url() + "/../" + fs::path(app->url()).filename().string() + "/x", app->url() + "//x", app->url() + "/./x",
        app->url() + "/x/", std::string("relative/x"), app->url(), classDirectory + "/", std::string()})
    EXPECT_EQ(QRVBundleExecutable::ownerOfExecutablePath(hostile, *env_.services), std::nullopt) << hostile;
}

}  // namespace

#include "platform/linux/QRVLinuxSandbox.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <thread>

#include "base/QRVPlist.h"
#include "support/QRVTestServices.h"

namespace {

using namespace std::chrono_literals;
using Verdict = QRVLinuxSandbox::Verdict;

const QRVAuditToken kHolder = QRVAuditToken::make(501, 501, 4242, 987654321);

class LinuxSandboxTest : public testing::Test {
 protected:
  QRVLinuxSandbox::Options options() {
    QRVLinuxSandbox::Options o;
    o.keyPath = root_.path() + "/run/quorva/extension.key";
    o.registryPath = root_.path() + "/run/quorva/sandbox.plist";
    return o;
  }
  QRVLinuxSandbox::Key key() {
    int err = 0;
    std::optional<QRVLinuxSandbox::Key> k = QRVLinuxSandbox::readKey(options().keyPath, &err);
    EXPECT_TRUE(k.has_value()) << strerror(err);
    return k.value_or(QRVLinuxSandbox::Key{});
  }
  std::string issue(QRVLinuxSandbox& sandbox, const std::string& path = "/private/var/mobile/Containers/Data/A") {
    int err = 0;
    std::optional<std::string> token = sandbox.issueExtension("com.kelva.sandbox.container", path, kHolder, &err);
    EXPECT_TRUE(token.has_value()) << strerror(err);
    return token.value_or("");
  }
  Verdict verify(const std::string& token, const QRVAuditToken* holder = &kHolder,
                 std::chrono::system_clock::time_point now = std::chrono::system_clock::now()) {
    return QRVLinuxSandbox::verifyExtension(token, key(), holder, now);
  }
  std::optional<QRVPlist> registryFile() {
    std::ifstream in(options().registryPath, std::ios::binary);
    std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    return QRVPlist::fromBytes(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size());
  }
  static QRVSandboxUserStateItem item(std::string identifier, std::optional<std::string> path, uint32_t uid = 501) {
    return {uid, 1000, QRVSandboxUserStateItem::kDataContainer, std::move(identifier), std::move(path)};
  }

  QRVTemporaryDirectory root_;
};

// --- Extension tokens -------------------------------------------------------------

TEST_F(LinuxSandboxTest, IssuedTokenVerifiesForItsHolderAndSaysWhatItGrants) {
  QRVLinuxSandbox sandbox(options());
  const std::string path = "/private/var/mobile/Containers/Data/Application/X; odd %name é";
  std::string token = issue(sandbox, path);
  QRVLinuxSandbox::Extension granted;
  auto now = std::chrono::system_clock::now();
  ASSERT_EQ(QRVLinuxSandbox::verifyExtension(token, key(), &kHolder, now, &granted), Verdict::kValid);
  EXPECT_EQ(granted.extensionClass, "com.kelva.sandbox.container");
  EXPECT_EQ(granted.path, path);
  EXPECT_EQ(granted.holder, kHolder);
  int64_t nowSeconds = std::chrono::duration_cast<std::chrono::seconds>(now.time_since_epoch()).count();
  EXPECT_NEAR(granted.expiry, nowSeconds + 24 * 3600, 5);
  EXPECT_EQ(std::count(token.begin(), token.end(), ';'), 5);  // the separators are never in a field
  EXPECT_EQ(token.rfind("qx1;", 0), 0u);
  EXPECT_EQ(verify(token, nullptr), Verdict::kValid);  // any holder

  // Other holders: another pid, or the same pid of a restarted process.
  QRVAuditToken otherPid = QRVAuditToken::make(501, 501, 4243, 987654321);
  QRVAuditToken restarted = QRVAuditToken::make(501, 501, 4242, 987654400);
  EXPECT_EQ(verify(token, &otherPid), Verdict::kWrongHolder);
  EXPECT_EQ(verify(token, &restarted), Verdict::kWrongHolder);

  // It expires after its lifetime; expiry is checked before the holder, so
  // an expired token says only that.
  QRVLinuxSandbox::Options o = options();
  o.extensionLifetime = 60s;
  QRVLinuxSandbox shortLived(o);
  token = issue(shortLived);
  now = std::chrono::system_clock::now();
  EXPECT_EQ(verify(token, &kHolder, now + 55s), Verdict::kValid);
  EXPECT_EQ(verify(token, &kHolder, now + 61s), Verdict::kExpired);
  EXPECT_EQ(verify(token, &otherPid, now + 61s), Verdict::kExpired);
}

TEST_F(LinuxSandboxTest, TamperedMalformedAndForeignTokensAreRefused) {
  QRVLinuxSandbox sandbox(options());
  std::string token = issue(sandbox);
  // Change one character in each field, the seal included.
  size_t field = 0;
  for (size_t i = 0; i < token.size(); i++) {
    if (token[i] == ';') continue;
    if (i > 0 && token[i - 1] != ';') continue;  // the first character of each field
    std::string bad = token;
    bad[i] = bad[i] == '1' ? '2' : '1';
    EXPECT_EQ(verify(bad), Verdict::kBadSeal) << "field " << field;
    field++;
  }
  EXPECT_EQ(field, 6u);
  std::string longer = token;
  longer.insert(token.rfind(';'), "x");
  EXPECT_EQ(verify(longer), Verdict::kBadSeal);
  EXPECT_EQ(verify(token.substr(0, token.size() - 2)), Verdict::kMalformed);
  EXPECT_EQ(verify("not a token"), Verdict::kMalformed);
  EXPECT_EQ(verify(""), Verdict::kMalformed);
  std::string upper = token;
  for (size_t i = token.rfind(';') + 1; i < upper.size(); i++) upper[i] = static_cast<char>(toupper(upper[i]));
  EXPECT_NE(verify(upper), Verdict::kValid);

  // A key of another boot seals differently.
  QRVLinuxSandbox::Key other = key();
  other[0] ^= 1;
  EXPECT_EQ(QRVLinuxSandbox::verifyExtension(token, other, &kHolder, std::chrono::system_clock::now()),
            Verdict::kBadSeal);
}

TEST_F(LinuxSandboxTest, KeyIsCreatedRootOnlyReadOnceAndSharedByTheBoot) {
  QRVLinuxSandbox::Options o = options();
  struct stat st;
  {
    QRVLinuxSandbox sandbox(o);
    EXPECT_NE(stat(o.keyPath.c_str(), &st), 0);  // not before the first use
    std::string first = issue(sandbox);
    ASSERT_EQ(stat(o.keyPath.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);
    EXPECT_EQ(st.st_size, 32);
    QRVLinuxSandbox::Key k = key();
    // Issuing again needs no file: the key was read once.
    ASSERT_EQ(unlink(o.keyPath.c_str()), 0);
    std::string second = issue(sandbox);
    EXPECT_EQ(QRVLinuxSandbox::verifyExtension(second, k, &kHolder, std::chrono::system_clock::now()),
              Verdict::kValid);
    // Put it back for the next instance of the same boot.
    std::ofstream(o.keyPath, std::ios::binary).write(reinterpret_cast<const char*>(k.data()), k.size());
    chmod(o.keyPath.c_str(), 0600);
  }
  QRVLinuxSandbox again(o);
  EXPECT_EQ(verify(issue(again)), Verdict::kValid);
}

TEST_F(LinuxSandboxTest, UnsafeKeyFilesAndBadArgumentsAreRefused) {
  QRVLinuxSandbox::Options o = options();
  std::filesystem::create_directories(root_.path() + "/run/quorva");
  std::ofstream(o.keyPath) << std::string(32, 'k');
  chmod(o.keyPath.c_str(), 0644);
  QRVLinuxSandbox sandbox(o);
  int err = 0;
  EXPECT_FALSE(sandbox.issueExtension("c", "/p", kHolder, &err));
  EXPECT_EQ(err, EPERM);
  std::ofstream(o.keyPath) << "short";
  chmod(o.keyPath.c_str(), 0600);
  EXPECT_FALSE(sandbox.issueExtension("c", "/p", kHolder, &err));
  EXPECT_EQ(err, EINVAL);
  // Retried on the next use once the file is sound.
  std::ofstream(o.keyPath) << std::string(32, 'k');
  EXPECT_TRUE(sandbox.issueExtension("c", "/p", kHolder, &err));

  for (auto [cls, path] : {std::pair{"", "/p"}, {"c", ""}, {"c", "relative/path"}}) {
    err = 0;
    EXPECT_FALSE(sandbox.issueExtension(cls, path, kHolder, &err));
    EXPECT_EQ(err, EINVAL);
  }
}

// --- User-state items ---------------------------------------------------------------

TEST_F(LinuxSandboxTest, MappingsArePublishedAtomicallyRootOnlyAndInFull) {
  QRVLinuxSandbox sandbox(options());
  EXPECT_EQ(sandbox.setUserStateItem(item("com.example.a", "/c/A")), 0);
  EXPECT_EQ(sandbox.setUserStateItem(item("com.example.b", "/c/B")), 0);
  EXPECT_EQ(sandbox.setUserStateItem(item("com.example.a", "/c/A", 502)), 0);  // another user: its own item
  EXPECT_EQ(sandbox.setUserStateItem(item("com.example.b", std::nullopt)), 0);  // removed
  sandbox.flushRegistry();

  std::optional<QRVPlist> file = registryFile();
  ASSERT_TRUE(file.has_value());
  EXPECT_EQ(file->uint64ForKey("QRVSandboxVersion"), 1u);
  const QRVPlist::Array& items = file->arrayForKey("QRVSandboxItems");
  ASSERT_EQ(items.size(), 2u);
  EXPECT_EQ(items[0].stringForKey("QRVSandboxIdentifier"), "com.example.a");
  EXPECT_EQ(items[0].stringForKey("QRVSandboxPath"), "/c/A");
  EXPECT_EQ(items[0].uint64ForKey("QRVSandboxUID"), 501u);
  EXPECT_EQ(items[0].uint64ForKey("QRVSandboxPersonaID"), 1000u);
  EXPECT_EQ(items[0].uint64ForKey("QRVSandboxItemType"), 1u);
  EXPECT_EQ(items[1].uint64ForKey("QRVSandboxUID"), 502u);
  struct stat st;
  ASSERT_EQ(stat(options().registryPath.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  // Only the file itself is left in the directory: no temporary files.
  size_t entries = 0;
  for (auto& e : std::filesystem::directory_iterator(root_.path() + "/run/quorva"))
    entries += e.path().filename() != "extension.key";
  EXPECT_EQ(entries, 1u);

  EXPECT_EQ(sandbox.setUserStateItem(item("", "/x")), EINVAL);
  EXPECT_EQ(sandbox.setUserStateItem(item("com.example.c", "relative")), EINVAL);
  EXPECT_EQ(sandbox.setUserStateItem(item("com.example.c", "")), EINVAL);
}

TEST_F(LinuxSandboxTest, BurstsAreCoalescedAndUnchangedItemsWriteNothing) {
  QRVLinuxSandbox::Options o = options();
  o.registryQueue = QRVSerialQueue::create("test.sandbox-registry");
  QRVLinuxSandbox sandbox(o);
  o.registryQueue->suspend();
  for (int i = 0; i < 200; i++) {
    sandbox.setUserStateItem(item("com.example.app" + std::to_string(i % 20), "/c/" + std::to_string(i)));
    if (i % 3 == 0) sandbox.setUserStateItem(item("com.example.app" + std::to_string(i % 20), std::nullopt));
  }
  EXPECT_EQ(sandbox.registryWriteCount(), 0u);
  EXPECT_FALSE(std::filesystem::exists(o.registryPath));  // nothing written on the caller's thread
  o.registryQueue->resume();
  sandbox.flushRegistry();
  EXPECT_EQ(sandbox.registryWriteCount(), 1u);
  std::optional<QRVPlist> file = registryFile();
  ASSERT_TRUE(file.has_value());
  EXPECT_EQ(file->arrayForKey("QRVSandboxItems").size(), sandbox.userStateItems().size());

  // Setting what is already there, or removing what is not, changes nothing.
  std::vector<QRVSandboxUserStateItem> current = sandbox.userStateItems();
  ASSERT_FALSE(current.empty());
  sandbox.setUserStateItem(current[0]);
  sandbox.setUserStateItem(item("com.example.absent", std::nullopt));
  sandbox.flushRegistry();
  EXPECT_EQ(sandbox.registryWriteCount(), 1u);
}

TEST_F(LinuxSandboxTest, AConcurrentReaderOnlyEverSeesWholeFiles) {
  QRVLinuxSandbox sandbox(options());
  sandbox.setUserStateItem(item("com.example.seed", "/c/seed"));
  sandbox.flushRegistry();
  std::atomic<bool> stop{false};
  std::atomic<int> reads{0}, broken{0};
  std::thread reader([&] {
    while (!stop) {
      std::optional<QRVPlist> file = registryFile();
      if (!file || file->arrayForKey("QRVSandboxItems").empty()) broken++;
      reads++;
    }
  });
  // Held open, the first file's inode cannot be reused by a later one.
  int first = open(options().registryPath.c_str(), O_RDONLY | O_CLOEXEC);
  ASSERT_GE(first, 0);
  for (int i = 0; i < 150; i++) {
    // A large file makes a torn read likely if writes were in place.
    sandbox.setUserStateItem(item("com.example.app" + std::to_string(i), "/c/" + std::string(200, 'p')));
    sandbox.flushRegistry();
  }
  stop = true;
  reader.join();
  struct stat before, after;
  fstat(first, &before);
  close(first);
  stat(options().registryPath.c_str(), &after);
  EXPECT_GT(reads, 0);
  EXPECT_EQ(broken, 0);
  EXPECT_NE(before.st_ino, after.st_ino);  // replaced by rename, not rewritten
  EXPECT_LT(before.st_size, after.st_size);  // and the first file was never touched again
  EXPECT_EQ(sandbox.registryWriteCount(), 151u);
}

TEST_F(LinuxSandboxTest, FailedWriteIsRetriedWithTheNextChangeAndARestartReadsTheFile) {
  QRVLinuxSandbox::Options o = options();
  // The registry's directory cannot be made: a file stands in the way.
  std::filesystem::create_directories(root_.path() + "/run");
  std::ofstream(root_.path() + "/run/quorva") << "in the way";
  {
    QRVLinuxSandbox sandbox(o);
    EXPECT_EQ(sandbox.setUserStateItem(item("com.example.a", "/c/A")), 0);  // kept in memory
    sandbox.flushRegistry();
    EXPECT_EQ(sandbox.registryWriteCount(), 0u);
    std::filesystem::remove(root_.path() + "/run/quorva");
    sandbox.setUserStateItem(item("com.example.b", "/c/B"));
  }  // destruction waits for the pending write
  QRVLinuxSandbox restarted(o);
  std::vector<QRVSandboxUserStateItem> items = restarted.userStateItems();
  ASSERT_EQ(items.size(), 2u);
  EXPECT_EQ(items[0], item("com.example.a", "/c/A"));
  EXPECT_EQ(items[1], item("com.example.b", "/c/B"));
}

}  // namespace

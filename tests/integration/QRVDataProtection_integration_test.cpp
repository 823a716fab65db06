// Class changes through the running daemon: command 21 on a container of a
// few thousand files, a device locked and unlocked through the daemon's
// lock-state file, and a change stopped dead at each crash point and
// finished by the next start. Classes are read back from the files' own
// extended attributes.
#include <gtest/gtest.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>
#include <string>
#include <vector>

#include "base/QRVResultCode.h"
#include "client/QRVClient.h"
#include "integration/QRVArmedDaemon.h"
#include "integration/QRVDaemonProcess.h"
#include "integration/QRVRunAs.h"
#include "support/QRVRequests.h"

namespace fs = std::filesystem;

namespace {

constexpr uid_t kInstallerUID = 2121;  // "allowed"
constexpr const char* kIdentifier = "com.example.protected";
constexpr const char* kClassKey = "com.kelva.Verdane.ContentProtectionClass";

QRVPlist setDataProtection(uint64_t protectionClass, bool retryIfLocked, bool thirdParty = false) {
  return QRVRequest(21)
      .set("Identifier", QRVPlist::string(kIdentifier))
      .set("ContainerClass", QRVPlist::uinteger(2))
      .set("DataProtectionClass", QRVPlist::uinteger(protectionClass))
      .set("IsThirdParty", QRVPlist::boolean(thirdParty))
      .set("RetryIfLocked", QRVPlist::boolean(retryIfLocked));
}

constexpr const char* kClassAttribute = "trusted.quorva.protection-class";

// The class the daemon gave `path`; 0 for none, 99 when unreadable.
uint32_t classOf(const fs::path& path) {
  uint8_t bytes[4];
  ssize_t n = lgetxattr(path.c_str(), kClassAttribute, bytes, sizeof bytes);
  if (n < 0) return errno == ENODATA ? 0 : 99;
  if (n != sizeof bytes) return 99;
  return uint32_t{bytes[0]} | uint32_t{bytes[1]} << 8 | uint32_t{bytes[2]} << 16 | uint32_t{bytes[3]} << 24;
}

// Calls `visit` with every regular file and directory of the container's
// data items, links left out.
template <typename Visit>
void forEachItem(const fs::path& container, Visit visit) {
  for (const char* item : {"Documents", "Library", "tmp"}) {
    visit(container / item);
    for (const auto& entry : fs::recursive_directory_iterator(container / item))
      if (!entry.is_symlink()) visit(entry.path());
  }
}

// The items whose class is not `expected`, one per line.
std::string itemsNotIn(const fs::path& container, uint32_t expected) {
  std::string wrong;
  forEachItem(container, [&](const fs::path& path) {
    if (uint32_t c = classOf(path); c != expected) wrong += path.string() + " has " + std::to_string(c) + "\n";
  });
  return wrong;
}

// Gives every item `protectionClass` behind the daemon's back, as if an
// earlier change had ended there.
void setEveryItemTo(const fs::path& container, uint32_t protectionClass) {
  const uint8_t bytes[4] = {static_cast<uint8_t>(protectionClass), 0, 0, 0};
  forEachItem(container, [&](const fs::path& path) {
    ASSERT_EQ(lsetxattr(path.c_str(), kClassAttribute, bytes, sizeof bytes, 0), 0) << path;
  });
}

class DataProtectionIntegrationTest : public testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root: clients run under other uids";
    daemon_.trustUID(kInstallerUID, "com.example.installer", QRVEntitlements({"allowed"}));
    // At debug level, so that a test can see when the daemon has noticed a
    // change of the lock state.
    daemon_.start({"--log-level", "7"});
    QRVPlist created = reply(QRVCreateRequest(kIdentifier, 2));
    ASSERT_EQ(QRVClient::resultCode(created), 1u);
    container_ = created.stringForKey("ReplyPath");
    uuid_ = created.dataForKey("ReplyUUID");
  }

  QRVPlist reply(const QRVPlist& request) { return QRVRepliesAs(daemon_, kInstallerUID, {request})[0]; }
  uint64_t code(const QRVPlist& request) { return QRVClient::resultCode(reply(request)); }

  // `count` files spread over nested directories of Documents and Library,
  // as an application leaves them, plus a link out of the container.
  void fill(int count) {
    for (int i = 0; i < count; i++) {
      fs::path dir = container_ / (i % 2 ? "Documents" : "Library") / ("d" + std::to_string(i % 17)) /
                     ("e" + std::to_string(i % 5));
      fs::create_directories(dir);
      std::ofstream(dir / ("f" + std::to_string(i))) << i;
    }
    fs::create_directories(daemon_.root() + "/outside");
    std::ofstream(daemon_.root() + "/outside/secret") << "not the application's";
    fs::create_directory_symlink(daemon_.root() + "/outside", container_ / "Documents" / "escape");
  }
  // Locks or unlocks the device; a lock returns once the daemon has noticed.
  void setLocked(bool locked) {
    std::ofstream(daemon_.root() + "/run/quorva/lockstate") << (locked ? "1\n" : "0\n");
    if (locked) {
      EXPECT_TRUE(daemon_.logEventuallyContains("LockState=1"));
    }
  }
  std::vector<fs::path> updateFiles() {
    std::vector<fs::path> files;
    const fs::path pending = daemon_.root() + "/private/var/root/Library/Quorva/PendingUpdates";
    if (fs::exists(pending))
      for (const auto& entry : fs::directory_iterator(pending)) files.push_back(entry.path());
    return files;
  }
  // The container as an earlier change to `protectionClass` left it.
  void resetTo(uint32_t protectionClass) {
    setEveryItemTo(container_, protectionClass);
    ASSERT_EQ(code(QRVRequest(5)
                       .set("Identifier", QRVPlist::string(kIdentifier))
                       .set("ContainerClass", QRVPlist::uinteger(2))
                       .set("UUID", QRVPlist::data(uuid_))
                       .set("Key", QRVPlist::string(kClassKey))
                       .set("Value", QRVPlist::uinteger(protectionClass))),
              1u);
  }
  // The class the container's info records, as a client reads it.
  uint64_t recordedClass() {
    QRVPlist r = reply(QRVRequest(6)
                           .set("Identifier", QRVPlist::string(kIdentifier))
                           .set("ContainerClass", QRVPlist::uinteger(2))
                           .set("UUID", QRVPlist::data(uuid_))
                           .set("Key", QRVPlist::string(kClassKey)));
    const QRVPlist* value = r.get("ReplyInfoValue");
    return QRVClient::resultCode(r) == 1 && value ? value->uint64Value() : 0;
  }

  QRVDaemonProcess daemon_;
  fs::path container_;
  QRVPlist::Bytes uuid_;
};

}  // namespace

// Refusals, a locked device without and with a retry: the answer to a
// retried change comes only after the unlock, with every file changed and
// nothing outside the container touched.
TEST_F(DataProtectionIntegrationTest, ALockedDeviceHoldsTheAnswerUntilTheUnlock) {
  fill(2000);
  resetTo(4);
  EXPECT_EQ(code(setDataProtection(2, true)), QRVResultCode::kInvalidInput);
  EXPECT_EQ(code(setDataProtection(uint64_t{1} << 32 | 1, true)), QRVResultCode::kInvalidInput) << "not cut to 1";
  EXPECT_EQ(code(setDataProtection(3, true, /*thirdParty=*/true)), QRVResultCode::kSuccess);
  EXPECT_EQ(code(setDataProtection(4, true, /*thirdParty=*/true)), QRVResultCode::kInvalidInput);
  EXPECT_EQ(recordedClass(), 3u);

  setLocked(true);
  EXPECT_EQ(code(setDataProtection(1, /*retryIfLocked=*/false)), QRVResultCode::kDeviceLocked);
  EXPECT_TRUE(updateFiles().empty());

  std::future<uint64_t> answer = std::async(std::launch::async, [&] { return code(setDataProtection(1, true)); });
  EXPECT_EQ(answer.wait_for(std::chrono::milliseconds(700)), std::future_status::timeout)
      << "answered while the device was locked";
  EXPECT_EQ(updateFiles().size(), 1u);
  EXPECT_EQ(classOf(container_ / "Documents" / "d1" / "e1" / "f1"), 3u);

  setLocked(false);
  ASSERT_EQ(answer.wait_for(std::chrono::seconds(30)), std::future_status::ready);
  EXPECT_EQ(answer.get(), QRVResultCode::kSuccess);
  EXPECT_EQ(itemsNotIn(container_, 1), "");
  EXPECT_EQ(classOf(daemon_.root() + "/outside"), 0u) << "followed a link out of the container";
  EXPECT_EQ(classOf(daemon_.root() + "/outside/secret"), 0u) << "followed a link out of the container";
  EXPECT_TRUE(updateFiles().empty());
  EXPECT_EQ(recordedClass(), 1u);
}

// Stopped dead after the update file is written, between two items, and
// before the file goes: the next start finishes the change.
TEST_F(DataProtectionIntegrationTest, AChangeStoppedDeadAtEachCrashPointIsFinishedByTheNextStart) {
  fill(3000);
  for (const char* point :
       {"dataprotection.update-written", "dataprotection.first-item-changed", "dataprotection.before-delete"}) {
    SCOPED_TRACE(point);
    resetTo(4);
    const uint64_t target = 1;
    daemon_.stop();
    QRVStartArmed(daemon_, point);
    QRVExpectStoppedDeadBy(daemon_, kInstallerUID, setDataProtection(target, true));
    EXPECT_EQ(updateFiles().size(), 1u) << "the change left no record of itself";
    // Where the crash came: before anything changed, between the items, or
    // after the last.
    const std::string untouched = itemsNotIn(container_, 4), unfinished = itemsNotIn(container_, target);
    const std::string at = point;
    if (at == "dataprotection.update-written") {
      EXPECT_EQ(untouched, "");
    } else if (at == "dataprotection.first-item-changed") {
      EXPECT_TRUE(!untouched.empty() && !unfinished.empty());
    } else {
      EXPECT_EQ(unfinished, "");
    }

    daemon_.start();
    EXPECT_TRUE(daemon_.logEventuallyContains("Starting pending data protection update to protection class " +
                                              std::to_string(target)));
    EXPECT_EQ(itemsNotIn(container_, static_cast<uint32_t>(target)), "");
    EXPECT_TRUE(updateFiles().empty());
    EXPECT_EQ(recordedClass(), target);
  }
}

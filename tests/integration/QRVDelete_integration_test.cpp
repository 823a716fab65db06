// Deleting, wiping and replacing containers through the running daemon.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "client/QRVClient.h"
#include "integration/QRVRunAs.h"
#include "support/QRVDaemonTest.h"
#include "support/QRVFiles.h"

namespace fs = std::filesystem;

namespace {

constexpr uid_t kInstallerUID = 2102;  // "allowed": unrestricted
constexpr uid_t kSettingsUID = 2103;   // "com.example.wiped", may wipe itself only

uint64_t code(const QRVPlist& reply) { return QRVClient::resultCode(reply); }
std::string path(const QRVPlist& reply) { return reply.stringForKey("ReplyPath"); }
QRVPlist::Bytes uuid(const QRVPlist& reply) { return reply.dataForKey("ReplyUUID"); }

// Sets the immutable flag as an application's root-owned helper could;
// false where the file system does not support it.
bool setImmutable(const std::string& file) {
  int fd = open(file.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  int flags = 0;
  bool ok = ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0;
  flags |= FS_IMMUTABLE_FL;
  ok = ok && ioctl(fd, FS_IOC_SETFLAGS, &flags) == 0;
  close(fd);
  return ok;
}

class DeleteIntegrationTest : public QRVDaemonTest {
 protected:
  void SetUp() override {
    startDaemon({{kInstallerUID, "com.example.installer", QRVEntitlements({"allowed"})},
                 {kSettingsUID, "com.example.wiped",
                  QRVPlist::dictionary().set("com.kelva.private.Quorva.wipeContainer",
                                             QRVPlist::array({QRVPlist::string("com.example.wiped")}))}});
  }
};

}  // namespace

TEST_F(DeleteIntegrationTest, WipeStageForDeleteAndDeleteContainer) {
  // The wiping client's own container: listed in its wipe right.
  auto own = QRVRepliesAs(daemon_, kSettingsUID, {QRVCreateRequest("com.example.wiped", 4)});
  ASSERT_EQ(code(own[0]), 1u);
  const std::string wiped = path(own[0]);
  QRVWriteText(wiped + "/Documents/secret.txt", "old");

  // It may wipe its listed identifier and nothing else.
  auto wipes =
      QRVRepliesAs(daemon_, kSettingsUID,
           {QRVRequest(11).set("Identifier", QRVPlist::string("com.example.wiped")),
            QRVRequest(11).set("Identifier", QRVPlist::string("com.example.a")), QRVCreateRequest("com.example.wiped", 4)});
  EXPECT_EQ(code(wipes[0]), 1u);
  EXPECT_EQ(code(wipes[1]), 55u);
  EXPECT_FALSE(fs::exists(wiped + "/Documents/secret.txt"));
  EXPECT_TRUE(fs::is_directory(wiped + "/Documents"));
  EXPECT_EQ(path(wipes[2]), wiped);
  EXPECT_EQ(uuid(wipes[2]), uuid(own[0]));

  auto created = QRVRepliesAs(daemon_, kInstallerUID, {QRVCreateRequest("com.example.a", 2), QRVCreateRequest("com.example.b", 2)});
  ASSERT_EQ(code(created[0]), 1u);
  ASSERT_EQ(code(created[1]), 1u);
  const std::string a = path(created[0]), b = path(created[1]);

  // Stage for delete: arrays of unequal lengths stage nothing.
  auto stage = [&](size_t personas) {
    QRVPlist::Array p(personas, QRVPlist::string(""));
    return QRVRequest(3)
        .set("ContainerClassesArray", QRVPlist::array({QRVPlist::uinteger(2)}))
        .set("UUIDsArray", QRVPlist::array({QRVPlist::data(uuid(created[0]))}))
        .set("IdentifiersArray", QRVPlist::array({QRVPlist::string("com.example.a")}))
        .set("PersonaUniqueStringsArray", QRVPlist::array(p));
  };
  auto staged = QRVRepliesAs(
      daemon_, kInstallerUID,
      {stage(2),
       QRVRequest(10).set("Identifier", QRVPlist::string("com.example.b")).set("ContainerClass", QRVPlist::uinteger(2))});
  EXPECT_EQ(code(staged[0]), 38u);
  EXPECT_TRUE(fs::exists(a));
  EXPECT_EQ(code(staged[1]), 1u);
  EXPECT_FALSE(fs::exists(b));

  // A file the application made immutable does not keep its container
  // alive, and nothing outside the container goes with it.
  QRVWriteText(a + "/Documents/stuck.txt", "stuck");
  const bool immutable = setImmutable(a + "/Documents/stuck.txt");
  const std::string bystander = daemon_.root() + "/private/var/mobile/bystander.txt";
  QRVWriteText(bystander, "still here");
  fs::create_symlink(bystander, a + "/Documents/link-out");

  staged = QRVRepliesAs(daemon_, kInstallerUID, {stage(1), QRVRequest(4)});
  EXPECT_EQ(code(staged[0]), 1u);
  EXPECT_FALSE(fs::exists(a));
  // Death row is empty once the reply to command 4 arrives.
  EXPECT_EQ(code(staged[1]), 1u);
  const std::string deathRow = daemon_.root() + "/private/var/root/Library/Caches/com.kelva.quorvad/Dead";
  EXPECT_TRUE(!fs::exists(deathRow) || fs::is_empty(deathRow)) << (immutable ? "with an immutable file" : "");
  EXPECT_EQ(QRVReadText(bystander), "still here");
}

TEST_F(DeleteIntegrationTest, ReplaceSwapsInTheNewContainer) {
  auto made =
      QRVRepliesAs(daemon_, kInstallerUID, {QRVCreateRequest("com.example.r", 2), QRVCreateRequest("com.example.r", 2, true)});
  ASSERT_EQ(code(made[0]), 1u);
  ASSERT_EQ(code(made[1]), 1u);
  QRVWriteText(path(made[0]) + "/old.txt", "old");
  QRVWriteText(path(made[1]) + "/new.txt", "new");

  QRVPlist replace = QRVRequest(2)
                         .set("OldIdentifier", QRVPlist::string("com.example.r"))
                         .set("OldContainerClass", QRVPlist::uinteger(2))
                         .set("OldContainerUUID", QRVPlist::data(uuid(made[0])))
                         .set("NewIdentifier", QRVPlist::string("com.example.r"))
                         .set("NewContainerClass", QRVPlist::uinteger(2))
                         .set("NewContainerUUID", QRVPlist::data(uuid(made[1])));
  QRVPlist acrossClasses = replace;
  acrossClasses.set("NewContainerClass", QRVPlist::uinteger(4));
  auto replies = QRVRepliesAs(daemon_, kInstallerUID, {acrossClasses, replace, QRVCreateRequest("com.example.r", 2)});
  EXPECT_EQ(code(replies[0]), 23u);
  EXPECT_EQ(code(replies[1]), 1u);
  EXPECT_EQ(uuid(replies[2]), uuid(made[1]));
  EXPECT_EQ(QRVReadText(path(replies[2]) + "/new.txt"), "new");
  EXPECT_FALSE(fs::exists(path(made[0])));
  EXPECT_TRUE(fs::is_empty(daemon_.root() + "/private/var/root/Library/Quorva/Replace"));

  // Command 12 empties it again, keeping its UUID and path.
  auto emptied = QRVRepliesAs(
      daemon_, kInstallerUID,
      {QRVRequest(12).set("Identifier", QRVPlist::string("com.example.r")).set("ContainerClass", QRVPlist::uinteger(2)),
       QRVCreateRequest("com.example.r", 2)});
  EXPECT_EQ(code(emptied[0]), 1u);
  EXPECT_EQ(path(emptied[1]), path(replies[2]));
  EXPECT_EQ(uuid(emptied[1]), uuid(made[1]));
  EXPECT_FALSE(fs::exists(path(replies[2]) + "/new.txt"));
  EXPECT_TRUE(fs::is_directory(path(replies[2]) + "/Library/Caches"));
}

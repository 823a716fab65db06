// Deleting, wiping and replacing containers through the running daemon, and
// the recovery of an interrupted replace at the next start.
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "QRVClient.h"
#include "QRVDaemonProcess.h"
#include "QRVRunAs.h"

namespace fs = std::filesystem;

namespace {

constexpr uid_t kInstallerUID = 2102;  // "allowed": unrestricted
constexpr uid_t kSettingsUID = 2103;   // "com.example.wiped", may wipe itself only

struct Reply {
  uint64_t code = 0;
  std::string path;
  QRVPlist::Bytes uuid;
};

QRVPlist command(uint64_t number) { return QRVPlist::dictionary().set("Command", QRVPlist::uinteger(number)); }
QRVPlist createRequest(const std::string& identifier, uint64_t containerClass, bool transient = false) {
  return command(0)
      .set("Identifier", QRVPlist::string(identifier))
      .set("ContainerClass", QRVPlist::uinteger(containerClass))
      .set("CreateIfNecessary", QRVPlist::boolean(true))
      .set("Transient", QRVPlist::boolean(transient));
}

// Sends the requests from a process of `uid`; the child reports each reply
// as one line "code path uuid-hex".
std::vector<Reply> send(const QRVDaemonProcess& daemon, uid_t uid, const std::vector<QRVPlist>& requests) {
  auto out = QRVRunAs(uid, uid, [&] {
    QRVClientError error;
    auto client = QRVClient::connect(daemon.root(), &error);
    if (!client) return std::string();
    std::ostringstream lines;
    for (const QRVPlist& r : requests) {
      auto reply = client->sendRequest(r, std::chrono::seconds(10), &error);
      if (!reply) {
        lines << "0 - -\n";
        continue;
      }
      const std::string& path = reply->stringForKey("ReplyPath");
      lines << QRVClient::resultCode(*reply) << " " << (path.empty() ? "-" : path) << " ";
      char hex[3];
      for (uint8_t b : reply->dataForKey("ReplyUUID")) {
        snprintf(hex, sizeof hex, "%02x", b);
        lines << hex;
      }
      lines << "-\n";
    }
    return lines.str();
  });
  std::vector<Reply> replies;
  std::istringstream in(out.value_or(""));
  for (std::string line; std::getline(in, line);) {
    std::istringstream f(line);
    Reply r;
    std::string hex;
    f >> r.code >> r.path >> hex;
    for (size_t i = 0; i + 1 < hex.size(); i += 2) r.uuid.push_back(std::stoi(hex.substr(i, 2), nullptr, 16));
    replies.push_back(r);
  }
  return replies;
}

void writeText(const std::string& path, const std::string& text) { std::ofstream(path) << text; }
std::string readText(const std::string& path) {
  std::ifstream in(path);
  return std::string(std::istreambuf_iterator<char>(in), {});
}

class DeleteIntegrationTest : public testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root: clients run under other uids";
    daemon_.trustUID(kInstallerUID, "com.example.installer",
                     QRVPlist::dictionary().set("com.kelva.private.Quorva.allowed", QRVPlist::boolean(true)));
    daemon_.trustUID(kSettingsUID, "com.example.wiped",
                     QRVPlist::dictionary().set("com.kelva.private.Quorva.wipeContainer",
                                                QRVPlist::array({QRVPlist::string("com.example.wiped")})));
    daemon_.start();
  }
  QRVDaemonProcess daemon_;
};

}  // namespace

TEST_F(DeleteIntegrationTest, WipeStageForDeleteAndDeleteContainer) {
  // The wiping client's own container: listed in its wipe right.
  auto own = send(daemon_, kSettingsUID, {createRequest("com.example.wiped", 4)});
  ASSERT_EQ(own.size(), 1u);
  ASSERT_EQ(own[0].code, 1u);
  const std::string wiped = own[0].path;
  writeText(wiped + "/Documents/secret.txt", "old");

  // It may wipe its listed identifier and nothing else.
  auto wipes =
      send(daemon_, kSettingsUID,
           {command(11).set("Identifier", QRVPlist::string("com.example.wiped")),
            command(11).set("Identifier", QRVPlist::string("com.example.a")), createRequest("com.example.wiped", 4)});
  ASSERT_EQ(wipes.size(), 3u);
  EXPECT_EQ(wipes[0].code, 1u);
  EXPECT_EQ(wipes[1].code, 55u);
  EXPECT_FALSE(fs::exists(wiped + "/Documents/secret.txt"));
  EXPECT_TRUE(fs::is_directory(wiped + "/Documents"));
  EXPECT_EQ(wipes[2].path, wiped);
  EXPECT_EQ(wipes[2].uuid, own[0].uuid);

  auto created = send(daemon_, kInstallerUID, {createRequest("com.example.a", 2), createRequest("com.example.b", 2)});
  ASSERT_EQ(created.size(), 2u);
  ASSERT_EQ(created[0].code, 1u);
  ASSERT_EQ(created[1].code, 1u);
  const std::string a = created[0].path, b = created[1].path;

  // Stage for delete: arrays of unequal lengths stage nothing.
  auto stage = [&](size_t personas) {
    QRVPlist::Array p(personas, QRVPlist::string(""));
    return command(3)
        .set("ContainerClassesArray", QRVPlist::array({QRVPlist::uinteger(2)}))
        .set("UUIDsArray", QRVPlist::array({QRVPlist::data(created[0].uuid)}))
        .set("IdentifiersArray", QRVPlist::array({QRVPlist::string("com.example.a")}))
        .set("PersonaUniqueStringsArray", QRVPlist::array(p));
  };
  auto staged = send(
      daemon_, kInstallerUID,
      {stage(2),
       command(10).set("Identifier", QRVPlist::string("com.example.b")).set("ContainerClass", QRVPlist::uinteger(2))});
  ASSERT_EQ(staged.size(), 2u);
  EXPECT_EQ(staged[0].code, 38u);
  EXPECT_TRUE(fs::exists(a));
  EXPECT_EQ(staged[1].code, 1u);
  EXPECT_FALSE(fs::exists(b));

  staged = send(daemon_, kInstallerUID, {stage(1), command(4)});
  ASSERT_EQ(staged.size(), 2u);
  EXPECT_EQ(staged[0].code, 1u);
  EXPECT_FALSE(fs::exists(a));
  // Death row is empty once the reply to command 4 arrives.
  EXPECT_EQ(staged[1].code, 1u);
  const std::string deathRow = daemon_.root() + "/private/var/root/Library/Caches/com.kelva.quorvad/Dead";
  EXPECT_TRUE(!fs::exists(deathRow) || fs::is_empty(deathRow));
}

TEST_F(DeleteIntegrationTest, ReplaceSwapsInTheNewContainer) {
  auto made =
      send(daemon_, kInstallerUID, {createRequest("com.example.r", 2), createRequest("com.example.r", 2, true)});
  ASSERT_EQ(made.size(), 2u);
  ASSERT_EQ(made[0].code, 1u);
  ASSERT_EQ(made[1].code, 1u);
  writeText(made[0].path + "/old.txt", "old");
  writeText(made[1].path + "/new.txt", "new");

  QRVPlist replace = command(2)
                         .set("OldIdentifier", QRVPlist::string("com.example.r"))
                         .set("OldContainerClass", QRVPlist::uinteger(2))
                         .set("OldContainerUUID", QRVPlist::data(made[0].uuid))
                         .set("NewIdentifier", QRVPlist::string("com.example.r"))
                         .set("NewContainerClass", QRVPlist::uinteger(2))
                         .set("NewContainerUUID", QRVPlist::data(made[1].uuid));
  QRVPlist acrossClasses = replace;
  acrossClasses.set("NewContainerClass", QRVPlist::uinteger(4));
  auto replies = send(daemon_, kInstallerUID, {acrossClasses, replace, createRequest("com.example.r", 2)});
  ASSERT_EQ(replies.size(), 3u);
  EXPECT_EQ(replies[0].code, 23u);
  EXPECT_EQ(replies[1].code, 1u);
  EXPECT_EQ(replies[2].uuid, made[1].uuid);
  EXPECT_EQ(readText(replies[2].path + "/new.txt"), "new");
  EXPECT_FALSE(fs::exists(made[0].path));
  EXPECT_TRUE(fs::is_empty(daemon_.root() + "/private/var/root/Library/Quorva/Replace"));

  // Command 12 empties it again, keeping its UUID and path.
  auto emptied = send(
      daemon_, kInstallerUID,
      {command(12).set("Identifier", QRVPlist::string("com.example.r")).set("ContainerClass", QRVPlist::uinteger(2)),
       createRequest("com.example.r", 2)});
  ASSERT_EQ(emptied.size(), 2u);
  EXPECT_EQ(emptied[0].code, 1u);
  EXPECT_EQ(emptied[1].path, replies[2].path);
  EXPECT_EQ(emptied[1].uuid, made[1].uuid);
  EXPECT_FALSE(fs::exists(replies[2].path + "/new.txt"));
  EXPECT_TRUE(fs::is_directory(replies[2].path + "/Library/Caches"));
}

TEST_F(DeleteIntegrationTest, AnInterruptedReplaceIsRolledBackAtTheNextStart) {
  auto made = send(daemon_, kInstallerUID, {createRequest("com.example.r", 2)});
  ASSERT_EQ(made.size(), 1u);
  ASSERT_EQ(made[0].code, 1u);
  const std::string old = made[0].path;
  writeText(old + "/old.txt", "old");
  daemon_.stop();

  // As a crash would leave it: the old directory parked, the journal naming it.
  const std::string staging = daemon_.root() + "/parked";
  fs::rename(old, staging);
  const std::string replaceDir = daemon_.root() + "/private/var/root/Library/Quorva/Replace";
  fs::create_directories(replaceDir);
  QRVPlist journal = QRVPlist::dictionary()
                         .set("QRVReplaceOperationOldURL", QRVPlist::string(old))
                         .set("QRVReplaceOperationNewURL", QRVPlist::string(daemon_.root() + "/gone"))
                         .set("QRVReplaceOperationStagingURL", QRVPlist::string(staging))
                         .set("QRVReplaceOperationDestURL", QRVPlist::string(old + "-dest"));
  auto bytes = journal.toBinary();
  std::ofstream(replaceDir + "/interrupted.plist", std::ios::binary)
      .write(reinterpret_cast<const char*>(bytes.data()), bytes.size());

  daemon_.start();
  // Requests are served after the start-up set-up, so once one is answered
  // the recovery has run.
  auto found = send(daemon_, kInstallerUID, {createRequest("com.example.r", 2)});
  ASSERT_EQ(found.size(), 1u);
  EXPECT_EQ(found[0].path, old);
  EXPECT_EQ(readText(old + "/old.txt"), "old");
  EXPECT_FALSE(fs::exists(staging));
  EXPECT_TRUE(fs::is_empty(replaceDir));
}

// A sandbox launcher asking the real daemon for a process's container paths,
// from processes under other uids, through the client library and quorvactl.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <fstream>

#include "client/QRVUpcallClient.h"
#include "integration/QRVDaemonProcess.h"
#include "integration/QRVRunAs.h"
#include "support/QRVUpcallPeer.h"

namespace {

constexpr gid_t kLaunchGroup = 650;
constexpr uid_t kLauncherUID = 601;  // holds the entitlement
constexpr uid_t kIntruderUID = 602;  // in the group, without the entitlement
constexpr uid_t kOutsiderUID = 603;  // not even in the group

class UpcallIntegrationTest : public testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root to run the daemon";
    std::ofstream(daemon_.root() + "/etc/group", std::ios::app) << "quorva-launch:x:" << kLaunchGroup << ":\n";
    daemon_.trustUID(kLauncherUID, "com.example.launcher",
                     QRVPlist::dictionary().set("com.kelva.private.Quorva.kernelUpcall", QRVPlist::boolean(true)));
    daemon_.start();
  }

  // What a process of `uid` in group `gid` is answered for `process`, as a
  // dictionary (QRVUpcallContainers::plist() with "ReturnCode"), or with
  // "Errno" when the exchange failed.
  QRVPlist askAs(uid_t uid, gid_t gid, const QRVUpcallProcess& process) {
    std::string root = daemon_.root();
    auto text = QRVRunAs(uid, gid, [&] {
      QRVClientError error;
      auto answer = QRVUpcallClient::ask(root, process, std::chrono::seconds(20), &error);
      if (!answer) return QRVPlist::dictionary().set("Errno", QRVPlist::uinteger(error.errnum)).toXML();
      return answer->containers.plist()
          .set("ReturnCode", QRVPlist::uinteger(static_cast<uint32_t>(answer->returnCode)))
          .toXML();
    });
    return text ? QRVPlist::fromXML(*text).value_or(QRVPlist::dictionary()) : QRVPlist::dictionary();
  }

  QRVDaemonProcess daemon_;
};

TEST_F(UpcallIntegrationTest, LauncherGetsEveryPathAndOthersAreRefused) {
  struct stat st;
  ASSERT_EQ(stat((daemon_.root() + "/run/quorvad/com.kelva.quorvad.upcall").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0660u);
  EXPECT_EQ(st.st_gid, kLaunchGroup);

  QRVUpcallProcess process;
  process.codeSigningIdentifier = "com.example.launched";
  process.uid = 501;
  process.appGroupIdentifiers = {"group.example.one", "group.example.two"};
  process.systemContainerIdentifier = "com.example.service";
  process.systemGroupIdentifiers = {"systemgroup.example"};
  QRVPlist answer = askAs(kLauncherUID, kLaunchGroup, process);
  ASSERT_EQ(answer.uint64ForKey("ReturnCode"), 0u) << answer.toXML();
  EXPECT_TRUE(answer.boolForKey("Complete")) << answer.toXML();
  EXPECT_EQ(answer.stringForKey("HomeDirectory"), daemon_.root() + "/private/var/mobile");
  std::string data = answer.stringForKey("DataContainer");
  EXPECT_TRUE(std::filesystem::is_directory(data)) << answer.toXML();
  EXPECT_EQ(answer.stringForKey("TempDirectory"), data + "/tmp");
  const QRVPlist* groups = answer.get("AppGroups");
  ASSERT_TRUE(groups && groups->isDictionary()) << answer.toXML();
  EXPECT_EQ(groups->dictionaryValue().size(), 2u);
  for (const auto& [group, path] : groups->dictionaryValue())
    EXPECT_TRUE(std::filesystem::is_directory(path.stringValue())) << group;
  EXPECT_TRUE(std::filesystem::is_directory(answer.stringForKey("SystemContainer")));
  const QRVPlist* systemGroups = answer.get("SystemGroups");
  ASSERT_TRUE(systemGroups && systemGroups->isDictionary());
  EXPECT_EQ(systemGroups->dictionaryValue().size(), 1u);

  // The same process asked again is given the same containers.
  EXPECT_EQ(askAs(kLauncherUID, kLaunchGroup, process).stringForKey("DataContainer"), data);

  // A member of the group without the entitlement is answered, with a no.
  QRVPlist refused = askAs(kIntruderUID, kLaunchGroup, process);
  EXPECT_EQ(refused.uint64ForKey("ReturnCode"), 55u) << refused.toXML();
  EXPECT_FALSE(refused.get("DataContainer"));
  EXPECT_TRUE(daemon_.logEventuallyContains("(uid 602) refused: it is neither root nor entitled to "
                                            "com.kelva.private.Quorva.kernelUpcall"));
  // Anyone else cannot reach the socket at all.
  EXPECT_EQ(askAs(kOutsiderUID, kOutsiderUID, process).uint64ForKey("Errno"), static_cast<uint64_t>(EACCES));
}

// The reply of the running daemon read byte by byte: the header, the sealed
// region, and the items in the order of the tables (home, data, temp, each
// group's identifier and path, the final status).
TEST_F(UpcallIntegrationTest, TheDaemonsReplyIsExactItemByItem) {
  using namespace QRVUpcallPeerSupport;
  std::vector<uint8_t> b;
  str(b, M::kRequestCodeSignatureID, "com.example.exact");
  item(b, 1, M::kRequestUID, 501);
  str(b, M::kRequestAppGroupID, "group.example.z");
  str(b, M::kRequestAppGroupID, "group.example.a");
  end(b);
  Peer peer(daemon_.root() + "/run/quorvad/com.kelva.quorvad.upcall");
  peer.send(request(static_cast<uint32_t>(b.size())), {memfd(b)});
  Peer::Reply r = peer.receive();

  std::vector<Item> got = replyItems(r);
  ASSERT_EQ(valueTypes(got), (std::vector<uint16_t>{100, 1, 2, 3, 4, 3, 4, 0}));
  EXPECT_EQ(got[0].text, daemon_.root() + "/private/var/mobile");
  EXPECT_TRUE(std::filesystem::is_directory(got[1].text)) << got[1].text;
  EXPECT_EQ(got[2].text, got[1].text + "/tmp");
  EXPECT_EQ(got[3].text, "group.example.a") << "groups in order of their identifiers";
  EXPECT_EQ(got[5].text, "group.example.z");
  EXPECT_TRUE(std::filesystem::is_directory(got[4].text)) << got[4].text;
  EXPECT_TRUE(std::filesystem::is_directory(got[6].text)) << got[6].text;
  EXPECT_EQ(got[7].value, 1u) << "every lookup succeeded";
}

TEST_F(UpcallIntegrationTest, QuorvactlAsksAsRoot) {
  std::string line = std::string(QUORVACTL_BINARY) + " --root " + daemon_.root() +
                     " --json upcall --code-signing-id com.example.tool --uid 501 --container-type 1 "
                     "--app-group group.example.tool 2>/dev/null";
  FILE* pipe = popen(line.c_str(), "r");
  ASSERT_TRUE(pipe);
  std::string out;
  char buffer[4096];
  for (size_t n; (n = fread(buffer, 1, sizeof buffer, pipe)) > 0;) out.append(buffer, n);
  EXPECT_EQ(pclose(pipe), 0) << out;
  EXPECT_NE(out.find("\"ReturnCode\": 0"), std::string::npos) << out;
  EXPECT_NE(out.find("\"Complete\": true"), std::string::npos) << out;
  EXPECT_NE(out.find("\"group.example.tool\": \"" + daemon_.root()), std::string::npos) << out;
  // Unknown to the installer and started as a plug-in: a plug-in container.
  EXPECT_TRUE(daemon_.logEventuallyContains("SB Type: 1, falling back to class: 4"));
}

}  // namespace

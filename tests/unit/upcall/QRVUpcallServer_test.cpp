// The upcall server behind its real socket transport, on a temporary root:
// replies checked byte by byte, hostile messages, leaks, and who may ask.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <fstream>
#include <thread>

#include "base/QRVDescriptorPassing.h"
#include "base/QRVUpcallMessage.h"
#include "codesigning/QRVCodeSigningMapping.h"
#include "core/QRVCommandQueue.h"
#include "platform/linux/QRVLinuxUpcallTransport.h"
#include "support/QRVEventually.h"
#include "support/QRVLogCapture.h"
#include "support/QRVTestServices.h"
#include "support/QRVUpcallPeer.h"
#include "upcall/QRVUpcallServer.h"

namespace fs = std::filesystem;
namespace M = QRVUpcallMessage;
using testing::HasSubstr;

using namespace QRVUpcallPeerSupport;

namespace {

size_t openDescriptors() {
  return std::distance(fs::directory_iterator("/proc/self/fd"), fs::directory_iterator());
}
// Mappings of memory files: the requests' regions, were any left mapped.
size_t memoryFileMappings() {
  std::ifstream maps("/proc/self/maps");
  size_t n = 0;
  for (std::string line; std::getline(maps, line);) n += line.find("/memfd:") != std::string::npos;
  return n;
}

// A request as a transport would hand it over, for senders that a test
// process cannot be.
class SentBy : public QRVUpcallRequest {
 public:
  SentBy(std::optional<QRVAuditToken> sender, std::vector<uint8_t> items)
      : message_(M::encodeRequest(M::kGetProcessContainersID, static_cast<uint32_t>(items.size()))),
        items_(std::move(items)),
        sender_(sender) {}
  const std::vector<uint8_t>& message() const override { return message_; }
  size_t messageLength() const override { return message_.size(); }
  std::optional<QRVAuditToken> sender() const override { return sender_; }
  size_t regionCount() const override { return 1; }
  std::unique_ptr<QRVUpcallMemory> mapRegion(size_t size, QRVError*) override {
    struct Held : QRVUpcallMemory {
      std::vector<uint8_t> b;
      const uint8_t* bytes() const override { return b.data(); }
      size_t size() const override { return b.size(); }
    };
    auto h = std::make_unique<Held>();
    h->b.assign(items_.begin(), items_.begin() + std::min(size, items_.size()));
    return h;
  }

 private:
  std::vector<uint8_t> message_, items_;
  std::optional<QRVAuditToken> sender_;
};

}  // namespace

class QRVUpcallServerTest : public testing::Test {
 protected:
  void SetUp() override {
    socketPath_ = env_.root.path() + "/run/quorvad/com.kelva.quorvad.upcall";
    transport_ = std::make_shared<QRVLinuxUpcallTransport>(QRVLinuxUpcallTransport::Options{socketPath_, {}, 64});
    env_.services->platform.upcall = transport_;
    server_ = std::make_unique<QRVUpcallServer>(env_.services);
    ASSERT_TRUE(server_->QRVKernServerStart(nullptr));
  }
  void TearDown() override {
    // The transport finishes its queued requests before the server goes.
    env_.services->platform.upcall.reset();
    transport_.reset();
    server_.reset();
  }
  // `identifier` known to the code-signing mapping with data class `c`.
  void install(const std::string& identifier, uint64_t c) {
    QRVCommandQueue queue;
    QRVPlist info = QRVPlist::dictionary().set(kQRVCodeSigningEntitlementsKey, QRVPlist::dictionary());
    QRVPlist options = QRVPlist::dictionary().set(kQRVDataContainerClassOption, QRVPlist::uinteger(c));
    ASSERT_EQ(env_.services->codeSigningMapping->processCodeSigningInfo(info, identifier, options, queue), 1u);
  }
  Peer::Reply ask(const std::vector<uint8_t>& items) {
    Peer peer(socketPath_);
    peer.send(request(static_cast<uint32_t>(items.size())), {memfd(items)});
    return peer.receive();
  }

  QRVTestServices env_;
  std::string socketPath_;
  std::shared_ptr<QRVLinuxUpcallTransport> transport_;
  std::unique_ptr<QRVUpcallServer> server_;
};

TEST_F(QRVUpcallServerTest, AnswersEveryPathItemByItemInTableOrder) {
  QRVLogCapture log(env_.root.path());
  // Known as an application, started by the sandbox as a plug-in.
  install("com.example.app", QRVContainerClassAppData);
  std::vector<uint8_t> b;
  str(b, M::kRequestCodeSignatureID, "com.example.app");
  item(b, 1, M::kRequestUID, 501);
  str(b, M::kRequestAppGroupID, "group.b");
  item(b, 1, M::kRequestContainerType, 1);
  str(b, M::kRequestAppGroupID, "group.a");
  str(b, M::kRequestSystemContainerID, "com.example.service");
  str(b, M::kRequestSystemGroupContainerID, "systemgroup.s");
  end(b);
  Peer::Reply r = ask(b);

  // The layout's numbers, spelled out once.
  static_assert(M::kMessageSize == 56 && M::kGetProcessContainersID + 100 == 322515000);
  std::vector<Item> got = replyItems(r);
  ASSERT_EQ(valueTypes(got), (std::vector<uint16_t>{100, 1, 2, 3, 4, 3, 4, 101, 102, 103, 0}));
  EXPECT_EQ(got[0].text, env_.root.path() + "/private/var/mobile");
  EXPECT_THAT(got[1].text, HasSubstr(std::string("/") + QRVContainerClassRelativeDirectory(4) + "/"));
  EXPECT_EQ(got[2].text, got[1].text + "/tmp");
  EXPECT_EQ(got[3].text, "group.a");
  EXPECT_EQ(got[5].text, "group.b");
  EXPECT_NE(got[4].text, got[6].text);
  EXPECT_EQ(got[8].text, "systemgroup.s");
  for (size_t i : {1, 4, 6, 7, 9}) EXPECT_TRUE(fs::is_directory(got[i].text)) << got[i].text;
  EXPECT_EQ(got[10].value, 1u);
  EXPECT_THAT(log.text(), HasSubstr("SB Type: 1, MI Type: 2.  Declaring this a plugin"));

  // Asked again, the same containers come back.
  std::vector<Item> again = items(ask(b).region);
  ASSERT_EQ(again.size(), got.size());
  for (size_t i = 0; i < got.size(); i++) EXPECT_EQ(again[i].text, got[i].text);
}

TEST_F(QRVUpcallServerTest, EdgeRequestsGetTheirStatuses) {
  QRVLogCapture log(env_.root.path());
  // Only the end item: uid 0's home and a clean status.
  std::vector<uint8_t> empty;
  end(empty);
  std::vector<Item> got = items(ask(empty).region);
  ASSERT_EQ(got.size(), 2u);
  EXPECT_EQ(got[0].valueType, 100);
  EXPECT_EQ(got[0].text, env_.root.path() + "/private/var/root");
  EXPECT_EQ(got[1].valueType, 0);
  EXPECT_EQ(got[1].value, 1u);

  Peer peer(socketPath_);
  auto code = [&](const std::vector<uint8_t>& items) {
    return peer.exchange(request(static_cast<uint32_t>(items.size())), {memfd(items)});
  };
  std::vector<uint8_t> unknown;
  item(unknown, 1, 9, 0);
  end(unknown);
  EXPECT_EQ(code(unknown), 4);
  EXPECT_THAT(log.text(), HasSubstr("unexpected value: 9"));

  std::vector<uint8_t> noNul;
  str(noNul, M::kRequestCodeSignatureID, "com.example.nonul", /*nul=*/false);
  end(noNul);
  EXPECT_EQ(code(noNul), 5);
  EXPECT_THAT(log.text(), HasSubstr("failed: to unpack string for QV_KERN_REQUEST_CODE_SIGNATURE_ID"));

  std::vector<uint8_t> wrongKind;  // an inline value where a string belongs, and the reverse
  item(wrongKind, 1, M::kRequestAppGroupID, 7);
  end(wrongKind);
  EXPECT_EQ(code(wrongKind), 5);
  std::vector<uint8_t> uidAsString;
  str(uidAsString, M::kRequestUID, "501");
  end(uidAsString);
  EXPECT_EQ(code(uidAsString), 5);
  EXPECT_THAT(log.text(), HasSubstr("failed: to unpack uint32 for QV_KERN_REQUEST_UID"));

  std::vector<uint8_t> noEnd;  // the string runs to the region's last byte
  str(noEnd, M::kRequestCodeSignatureID, "com.example.cut");
  EXPECT_EQ(code(noEnd), 5);

  std::vector<uint8_t> persona;  // a persona the device does not have
  str(persona, M::kRequestCodeSignatureID, "com.example.app");
  item(persona, 1, M::kRequestPersonaID, 4242);
  end(persona);
  EXPECT_EQ(code(persona), 4);
  EXPECT_THAT(log.text(), HasSubstr("Could not look up info for persona id 4242"));

  // A group that cannot be made leaves the rest of the answer standing.
  std::vector<uint8_t> badGroup;
  str(badGroup, M::kRequestCodeSignatureID, "com.example.app");
  item(badGroup, 1, M::kRequestUID, 501);
  str(badGroup, M::kRequestAppGroupID, "");
  str(badGroup, M::kRequestAppGroupID, "group.ok");
  end(badGroup);
  got = items(ask(badGroup).region);
  std::vector<uint16_t> types;
  for (const Item& i : got) types.push_back(i.valueType);
  EXPECT_EQ(types, (std::vector<uint16_t>{100, 1, 2, 3, 4, 0}));
  EXPECT_EQ(got.back().value, 0u);
  EXPECT_THAT(log.text(), HasSubstr("createOrLookupGroupContainersForUser: Failed with error: 18"));
}

TEST_F(QRVUpcallServerTest, HostileMessagesAreRefusedWithoutLeaks) {
  QRVLogCapture log(env_.root.path(), QRVLogLevel::kNotice);
  std::vector<uint8_t> good;
  str(good, M::kRequestCodeSignatureID, "com.example.app");
  end(good);
  const uint32_t size = static_cast<uint32_t>(good.size());
  std::vector<uint8_t> longer = good;  // the region holds more than claimed: only the claim is read
  longer.resize(longer.size() + 64, 0xff);
  std::vector<uint8_t> mismatched = request(size);
  mismatched[52] ^= 8;  // count disagrees with the descriptor size
  std::vector<uint8_t> simple = request(size);
  simple[3] = 0;  // not complex
  std::vector<uint8_t> tooLong = request(size);
  tooLong.resize(60);
  std::vector<uint8_t> huge = request(1u << 30);  // far beyond any process description
  std::vector<uint8_t> truncated = request(size);
  truncated.resize(30);

  auto round = [&](Peer& peer) {
    int pipeFds[2];
    EXPECT_EQ(pipe2(pipeFds, O_CLOEXEC), 0);
    close(pipeFds[1]);
    EXPECT_EQ(peer.exchange(request(size), {memfd(longer)}), 0);
    EXPECT_EQ(peer.exchange(request(size)), -300);                              // no region
    EXPECT_EQ(peer.exchange(request(size), {memfd(good), memfd(good)}), -300);  // two
    EXPECT_EQ(peer.exchange(request(size), {memfd(good, 0)}), -300);            // unsealed
    EXPECT_EQ(peer.exchange(request(size), {memfd(good, F_SEAL_WRITE | F_SEAL_GROW)}), -300);
    EXPECT_EQ(peer.exchange(request(size + 8), {memfd(good)}), -300);  // shorter than claimed
    EXPECT_EQ(peer.exchange(request(size), {pipeFds[0]}), -300);       // not memory
    EXPECT_EQ(peer.exchange(mismatched, {memfd(good)}), -300);
    EXPECT_EQ(peer.exchange(simple, {memfd(good)}), -300);
    EXPECT_EQ(peer.exchange(tooLong, {memfd(good)}), -300);
    EXPECT_EQ(peer.exchange(truncated, {memfd(good)}), -300);
    EXPECT_EQ(peer.exchange(huge, {memfd(good)}), -300);
    EXPECT_EQ(peer.exchange(request(size, M::kUnservedID), {memfd(good)}, M::kUnservedID), -303);
    EXPECT_EQ(peer.exchange(request(size, 7), {memfd(good)}, 7), -303);
    EXPECT_EQ(peer.exchange(request(0), {memfd({})}), 4);  // an empty region holds no buffer
    // A peer that leaves before its answer.
    Peer leaving(socketPath_);
    leaving.send(request(size), {memfd(good)});
  };
  {
    Peer warmUp(socketPath_);
    round(warmUp);
  }
  ASSERT_TRUE(QRVEventually([&] { return transport_->openConnections() == 0; }));
  const size_t descriptors = openDescriptors();
  const size_t mappings = memoryFileMappings();
  {
    Peer peer(socketPath_);
    for (int i = 0; i < 150 && !HasFailure(); i++) round(peer);  // 2,400 requests
  }
  EXPECT_TRUE(QRVEventually([&] { return transport_->openConnections() == 0; }));
  EXPECT_EQ(openDescriptors(), descriptors);
  EXPECT_EQ(memoryFileMappings(), mappings);
}

TEST_F(QRVUpcallServerTest, OnlyRootAndEntitledPeersAreServed) {
  // The socket is for root and the launchers' group, nobody else.
  struct stat st;
  ASSERT_EQ(stat(socketPath_.c_str(), &st), 0);
  EXPECT_TRUE(S_ISSOCK(st.st_mode));
  EXPECT_EQ(st.st_mode & 0777, 0660u);
  EXPECT_EQ(st.st_uid, 0u);

  QRVLogCapture log(env_.root.path());
  std::vector<uint8_t> b;
  str(b, M::kRequestCodeSignatureID, "com.example.app");
  end(b);
  auto answer = [&](std::optional<QRVAuditToken> sender) {
    SentBy request(sender, b);
    QRVUpcallReply reply;
    EXPECT_TRUE(server_->demux_server(request, &reply));
    return M::decodeReturnCode(reply.message.data(), reply.message.size()).value_or(0);
  };
  const QRVAuditToken app = QRVAuditToken::make(501, 501, 4242, 7);
  EXPECT_EQ(answer(app), 55);
  EXPECT_THAT(log.text(), HasSubstr("upcall from pid 4242 (uid 501) refused"));
  env_.trustStore->setClient(4242, {"com.example.launcher", QRVPlist::dictionary().set(
                                                                QRVUpcallServer::kEntitlement, QRVPlist::string("yes"))});
  EXPECT_EQ(answer(app), 55);
  env_.trustStore->setClient(4242, {"com.example.launcher", QRVPlist::dictionary().set(
                                                                QRVUpcallServer::kEntitlement, QRVPlist::boolean(true))});
  EXPECT_EQ(answer(app), 0);
  EXPECT_EQ(answer(QRVAuditToken::make(0, 0, 99, 1)), 0);
  EXPECT_EQ(answer(std::nullopt), -309);
}

TEST_F(QRVUpcallServerTest, ThePersonaPicksTheUserIdentity) {
  env_.personas->supported = true;
  auto persona = [](uint32_t id, uint32_t type, const char* unique, const char* home) {
    QRVPersona p;
    p.personaID = id, p.uid = 501, p.gid = 501, p.type = type, p.uniqueString = unique, p.home = home;
    return p;
  };
  env_.personas->list = {persona(1000, 0, "PERSONAL", "/private/var/mobile"),
                         persona(2000, 1, "WORK", "/private/var/work"),
                         persona(3000, 2, "GUEST", "/private/var/guest")};
  env_.services->userIdentityCache->flush();
  fs::create_directories(env_.root.path() + "/private/var/work/Containers");
  auto asked = [&](uint32_t personaID) {
    std::vector<uint8_t> b;
    str(b, M::kRequestCodeSignatureID, "com.example.app");
    item(b, 1, M::kRequestUID, 501);
    item(b, 1, M::kRequestPersonaID, personaID);
    end(b);
    return items(ask(b).region);
  };
  // The enterprise persona has containers of its own; a guest uses the
  // personal user's, as does a request without persona.
  std::vector<Item> work = asked(2000);
  ASSERT_EQ(work.size(), 4u);
  EXPECT_EQ(work[0].text, env_.root.path() + "/private/var/work");
  EXPECT_EQ(work[1].text.rfind(env_.root.path() + "/private/var/work/", 0), 0u) << work[1].text;
  std::vector<Item> personal = asked(M::kNoPersona);
  ASSERT_EQ(personal.size(), 4u);
  EXPECT_EQ(personal[0].text, env_.root.path() + "/private/var/mobile");
  EXPECT_NE(personal[1].text, work[1].text);
  std::vector<Item> guest = asked(3000);
  ASSERT_EQ(guest.size(), 4u);
  EXPECT_EQ(guest[1].text, personal[1].text);
  EXPECT_EQ(asked(1000)[1].text, personal[1].text);
}

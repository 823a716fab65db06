// The typed container calls: the requests they build, how replies are read
// back, and the round trip through a peer on a socketpair.
#include "client/QRVContainerClient.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <thread>

#include "base/QRVWireFrame.h"

using namespace std::chrono_literals;
namespace R = QRVContainerRequests;

namespace {

const QRVUUIDBytes kUUID = {1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15, 16};
const QRVUUIDBytes kOtherUUID = {16, 15, 14, 13, 12, 11, 10, 9, 8, 7, 6, 5, 4, 3, 2, 1};

QRVPlist uuidData(const QRVUUIDBytes& u) { return QRVPlist::data(QRVPlist::Bytes(u.begin(), u.end())); }
QRVPlist reply(uint64_t code) { return QRVPlist::dictionary().set("ReplyError", QRVPlist::uinteger(code)); }

TEST(ContainerRequestsTest, EachCallSendsItsOwnCommandNumber) {
  const QRVContainerRef c{"com.example.a", 2, std::nullopt, kUUID};
  const std::pair<QRVPlist, uint64_t> cases[] = {
      {R::createOrLookupContainer(c, true, false), 0}, {R::containersWithClass(2, true), 1},
      {R::replaceContainer(c, c), 2}, {R::stageContainersForDelete({}), 3}, {R::deleteContainersOnDeathRow(), 4},
      {R::setInfoValue(c, "k", QRVPlist::uinteger(1)), 5}, {R::infoValueForKey(c, "k"), 6},
      {R::containerMetadata(c, true), 7}, {R::recreateDefaultStructure(c), 8}, {R::regenerateDirectoryUUID(c), 9},
      {R::deleteContainer(c, true), 10}, {R::wipeContainerContent(c), 11}, {R::deleteContainerContent(c), 12},
      {R::diskUsage(c), 23}, {R::retryTest(3), 25}, {R::stageSharedContent("a", "/src", "dst"), 26},
      {R::userManagedAssetsPath("a", std::nullopt, true, false), 28},
      {R::deleteUserManagedAsset("a", std::nullopt, "x"), 29}, {R::setTestLock(2, true), 31}};
  for (const auto& [request, command] : cases) {
    SCOPED_TRACE(command);
    ASSERT_NE(request.get("Command"), nullptr);
    EXPECT_EQ(*request.get("Command"), QRVPlist::uinteger(command));
  }
}

TEST(ContainerRequestsTest, ContainersAreNamedWithTheDaemonsKeysAndTypes) {
  // A UUID travels as 16 bytes of data; an absent persona sends no key.
  EXPECT_EQ(R::diskUsage({"com.example.a", 2, std::nullopt, kUUID}),
            QRVPlist::dictionary()
                .set("Command", QRVPlist::uinteger(23))
                .set("Identifier", QRVPlist::string("com.example.a"))
                .set("ContainerClass", QRVPlist::uinteger(2))
                .set("UUID", uuidData(kUUID)));
  EXPECT_EQ(R::createOrLookupContainer({"com.example.a", 2, "P1", std::nullopt}, true, false),
            QRVPlist::dictionary()
                .set("Command", QRVPlist::uinteger(0))
                .set("Identifier", QRVPlist::string("com.example.a"))
                .set("ContainerClass", QRVPlist::uinteger(2))
                .set("PersonaUniqueString", QRVPlist::string("P1"))
                .set("CreateIfNecessary", QRVPlist::boolean(true))
                .set("Transient", QRVPlist::boolean(false)));
  // The two sides of a replace spell their UUID keys differently.
  EXPECT_EQ(R::replaceContainer({"old", 2, std::nullopt, kUUID}, {"new", 2, std::nullopt, kOtherUUID}),
            QRVPlist::dictionary()
                .set("Command", QRVPlist::uinteger(2))
                .set("OldIdentifier", QRVPlist::string("old"))
                .set("OldContainerClass", QRVPlist::uinteger(2))
                .set("OldContainerUUID", uuidData(kUUID))
                .set("NewIdentifier", QRVPlist::string("new"))
                .set("NewContainerClass", QRVPlist::uinteger(2))
                .set("NewContainerUUID", uuidData(kOtherUUID)));
  // Stage-for-delete sends parallel arrays, an empty string for no persona.
  QRVPlist stage = R::stageContainersForDelete({{"a", 2, kUUID, ""}, {"b", 7, kOtherUUID, "P"}});
  EXPECT_EQ(stage.arrayForKey("IdentifiersArray"), (QRVPlist::Array{QRVPlist::string("a"), QRVPlist::string("b")}));
  EXPECT_EQ(stage.arrayForKey("ContainerClassesArray"),
            (QRVPlist::Array{QRVPlist::uinteger(2), QRVPlist::uinteger(7)}));
  EXPECT_EQ(stage.arrayForKey("UUIDsArray"), (QRVPlist::Array{uuidData(kUUID), uuidData(kOtherUUID)}));
  EXPECT_EQ(stage.arrayForKey("PersonaUniqueStringsArray"),
            (QRVPlist::Array{QRVPlist::string(""), QRVPlist::string("P")}));
  EXPECT_EQ(R::userManagedAssetsPath("a", std::string("P"), true, false),
            QRVPlist::dictionary()
                .set("Command", QRVPlist::uinteger(28))
                .set("Identifier", QRVPlist::string("a"))
                .set("PersonaUniqueString", QRVPlist::string("P"))
                .set("IsRelative", QRVPlist::boolean(true))
                .set("CreateIfNecessary", QRVPlist::boolean(false)));
}

TEST(ContainerResultTest, WellFormedFieldsAreReadAndMistypedOnesStayEmpty) {
  auto good = QRVContainerResult::fromReply(
      reply(1)
          .set("ReplyPath", QRVPlist::string("/data/c"))
          .set("ReplyUUID", uuidData(kUUID))
          .set("ReplyExisted", QRVPlist::boolean(false))
          .set("ReplyTransient", QRVPlist::boolean(true))
          .set("ReplyIdentifier", QRVPlist::string("com.example.a"))
          .set("ReplyPersonaUniqueString", QRVPlist::string("P1"))
          .set("ReplyDiskUsage", QRVPlist::uinteger(4096))
          .set("ReplyInfoValue", QRVPlist::uinteger(42))
          .set("ReplyInfoDictionary", QRVPlist::dictionary().set("k", QRVPlist::uinteger(42)))
          .set("ReplyIdsArray", QRVPlist::array({QRVPlist::string("a"), QRVPlist::string("b")}))
          .set("ReplyUUIDsArray", QRVPlist::array({uuidData(kUUID), uuidData(kOtherUUID)}))
          .set("ReplyPersonaUniqueStringsArray", QRVPlist::array({QRVPlist::string(""), QRVPlist::string("")})));
  EXPECT_TRUE(good.ok());
  EXPECT_EQ(good.path, "/data/c");
  EXPECT_EQ(good.uuid, kUUID);
  EXPECT_EQ(good.existed, false);
  EXPECT_EQ(good.transient, true);
  EXPECT_EQ(good.identifier, "com.example.a");
  EXPECT_EQ(good.persona, "P1");
  EXPECT_EQ(good.diskUsage, 4096u);
  EXPECT_EQ(good.infoValue, QRVPlist::uinteger(42));
  ASSERT_TRUE(good.infoDictionary);
  EXPECT_EQ(good.infoDictionary->uint64ForKey("k"), 42u);
  EXPECT_EQ(good.identifiers, (std::vector<std::string>{"a", "b"}));
  EXPECT_EQ(good.uuids, (std::vector<QRVUUIDBytes>{kUUID, kOtherUUID}));
  EXPECT_EQ(good.personas.size(), 2u);

  // Wrong types: a string UUID, a numeric path, a short data UUID in the
  // list, a textual size, an info dictionary that is not one, a textual code.
  auto bad = QRVContainerResult::fromReply(
      QRVPlist::dictionary()
          .set("ReplyError", QRVPlist::string("1"))
          .set("ReplyUUID", QRVPlist::string("not data"))
          .set("ReplyPath", QRVPlist::uinteger(3))
          .set("ReplyExisted", QRVPlist::uinteger(1))
          .set("ReplyUUIDsArray", QRVPlist::array({QRVPlist::data({1, 2}), uuidData(kOtherUUID)}))
          .set("ReplyDiskUsage", QRVPlist::string("4096"))
          .set("ReplyInfoDictionary", QRVPlist::array()));
  EXPECT_FALSE(bad.ok());
  EXPECT_FALSE(bad.uuid);
  EXPECT_FALSE(bad.path);
  EXPECT_FALSE(bad.existed);
  EXPECT_FALSE(bad.diskUsage);
  EXPECT_FALSE(bad.infoDictionary);
  EXPECT_EQ(bad.uuids, std::vector<QRVUUIDBytes>{kOtherUUID});
}

TEST(ContainerClientTest, CallsSendTheRequestAndAFailureCodeIsStillAResult) {
  int fds[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
  std::vector<QRVPlist> served;
  // Answers two requests, the second with "no such container", then hangs up.
  std::thread daemon([&, fd = fds[1]] {
    for (uint64_t code : {1, 21}) {
      uint8_t header[QRVWireFrame::kHeaderSize];
      if (recv(fd, header, sizeof header, MSG_WAITALL) != static_cast<ssize_t>(sizeof header)) break;
      QRVWireFrame::Header h = QRVWireFrame::decodeHeader(header);
      std::vector<uint8_t> body(h.length);
      if (recv(fd, body.data(), body.size(), MSG_WAITALL) != static_cast<ssize_t>(body.size())) break;
      served.push_back(QRVWireFrame::decodeBody(body.data(), body.size()).value_or(QRVPlist()));
      auto out = QRVWireFrame::encode(reply(code).set("ReplyPath", QRVPlist::string("/c")), 0, h.messageId);
      if (write(fd, out.data(), out.size()) != static_cast<ssize_t>(out.size())) break;
    }
    close(fd);
  });
  QRVContainerClient client(QRVClient::adoptSocket(fds[0]), 5s);
  const QRVContainerRef c{"com.example.a", 2, std::nullopt, kUUID};
  QRVClientError error;
  auto looked = client.createOrLookupContainer(c, /*create=*/true, /*transient=*/false, &error);
  ASSERT_TRUE(looked) << error.message;
  EXPECT_TRUE(looked->ok());
  EXPECT_EQ(looked->path, "/c");
  auto regenerated = client.regenerateDirectoryUUID(c, &error);
  ASSERT_TRUE(regenerated) << error.message;
  EXPECT_FALSE(regenerated->ok());
  EXPECT_EQ(regenerated->code, 21u);
  daemon.join();
  ASSERT_EQ(served.size(), 2u);
  EXPECT_EQ(served[0], R::createOrLookupContainer(c, true, false));
  EXPECT_EQ(served[1], R::regenerateDirectoryUUID(c));
  // The peer has hung up: no reply is no result, and says why.
  EXPECT_FALSE(client.diskUsage(c, &error));
  EXPECT_NE(error.errnum, 0);
}

}  // namespace

// The typed container calls against a fake daemon on a Unix socket in a
// temporary directory: what each call puts on the wire and what it reads
// back from the reply.
#include "QRVContainerClient.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <functional>
#include <thread>

#include "QRVWireFrame.h"

using namespace std::chrono_literals;
namespace fs = std::filesystem;

namespace {

const QRVUUIDBytes kUUID = {1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15, 16};
const QRVUUIDBytes kOtherUUID = {16, 15, 14, 13, 12, 11, 10, 9, 8, 7, 6, 5, 4, 3, 2, 1};

QRVPlist uuidData(const QRVUUIDBytes& u) { return QRVPlist::data(QRVPlist::Bytes(u.begin(), u.end())); }

// Listens on "<tmp>/sock"; answers each request with what `answer` returns
// for it and remembers the requests.
class ContainerClientTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/qrv-container-client-XXXXXX";
    ASSERT_NE(mkdtemp(pattern), nullptr);
    dir_ = pattern;
    listener_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::string path = dir_ + "/sock";
    strncpy(address.sun_path, path.c_str(), sizeof(address.sun_path) - 1);
    ASSERT_EQ(bind(listener_, reinterpret_cast<sockaddr*>(&address), sizeof(address)), 0);
    ASSERT_EQ(listen(listener_, 1), 0);
  }
  void TearDown() override {
    if (server_.joinable()) server_.join();
    close(listener_);
    fs::remove_all(dir_);
  }

  // Serves `count` requests on one connection and returns the typed client.
  QRVContainerClient serve(size_t count, std::function<QRVPlist(const QRVPlist&)> answer) {
    server_ = std::thread([this, count, answer] {
      int fd = accept(listener_, nullptr, nullptr);
      for (size_t i = 0; i < count && fd >= 0; i++) {
        uint8_t header[QRVWireFrame::kHeaderSize];
        if (!readExactly(fd, header, sizeof(header))) break;
        QRVWireFrame::Header h = QRVWireFrame::decodeHeader(header);
        std::vector<uint8_t> body(h.length);
        if (!readExactly(fd, body.data(), body.size())) break;
        QRVPlist request = QRVWireFrame::decodeBody(body.data(), body.size()).value_or(QRVPlist());
        requests_.push_back(request);
        std::vector<uint8_t> out = QRVWireFrame::encode(answer(request), 0, h.messageId);
        if (::write(fd, out.data(), out.size()) != static_cast<ssize_t>(out.size())) break;
      }
      if (fd >= 0) close(fd);
    });
    QRVClientError error;
    auto client = QRVClient::connectToSocket(dir_ + "/sock", &error);
    EXPECT_TRUE(client) << error.message;
    return QRVContainerClient(std::move(*client), 5s);
  }
  // The requests seen, once the server has served them all.
  const std::vector<QRVPlist>& served() {
    server_.join();
    return requests_;
  }

 private:
  static bool readExactly(int fd, uint8_t* p, size_t n) {
    while (n > 0) {
      ssize_t r = ::read(fd, p, n);
      if (r <= 0) return false;
      p += r;
      n -= static_cast<size_t>(r);
    }
    return true;
  }
  std::string dir_;
  int listener_ = -1;
  std::thread server_;
  std::vector<QRVPlist> requests_;
};

QRVPlist success() { return QRVPlist::dictionary().set("ReplyError", QRVPlist::uinteger(1)); }

TEST_F(ContainerClientTest, LookupAndListSendTypedKeysAndParseReplies) {
  QRVContainerClient client = serve(2, [](const QRVPlist& request) {
    QRVPlist reply = success();
    if (request.uint64ForKey("Command") == 0) {
      reply.set("ReplyPath", QRVPlist::string("/data/c"))
          .set("ReplyUUID", uuidData(kUUID))
          .set("ReplyExisted", QRVPlist::boolean(false))
          .set("ReplyIdentifier", QRVPlist::string("com.example.a"))
          .set("ReplyPersonaUniqueString", QRVPlist::string("P1"));
    } else {
      reply.set("ReplyIdsArray", QRVPlist::array({QRVPlist::string("a"), QRVPlist::string("b")}))
          .set("ReplyUUIDsArray", QRVPlist::array({uuidData(kUUID), uuidData(kOtherUUID)}))
          .set("ReplyPersonaUniqueStringsArray", QRVPlist::array({QRVPlist::string(""), QRVPlist::string("")}));
    }
    return reply;
  });
  QRVClientError error;
  auto lookup = client.createOrLookupContainer({"com.example.a", 2, "P1", std::nullopt}, true, false, &error);
  ASSERT_TRUE(lookup) << error.message;
  EXPECT_TRUE(lookup->ok());
  EXPECT_EQ(lookup->path, "/data/c");
  EXPECT_EQ(lookup->uuid, kUUID);
  EXPECT_EQ(lookup->existed, false);
  EXPECT_EQ(lookup->identifier, "com.example.a");
  EXPECT_EQ(lookup->persona, "P1");

  auto list = client.containersWithClass(2, true, &error);
  ASSERT_TRUE(list) << error.message;
  EXPECT_EQ(list->identifiers, (std::vector<std::string>{"a", "b"}));
  EXPECT_EQ(list->uuids, (std::vector<QRVUUIDBytes>{kUUID, kOtherUUID}));
  EXPECT_EQ(list->personas.size(), 2u);

  const auto& requests = served();
  ASSERT_EQ(requests.size(), 2u);
  EXPECT_EQ(requests[0], QRVPlist::dictionary()
                             .set("Command", QRVPlist::uinteger(0))
                             .set("Identifier", QRVPlist::string("com.example.a"))
                             .set("ContainerClass", QRVPlist::uinteger(2))
                             .set("PersonaUniqueString", QRVPlist::string("P1"))
                             .set("CreateIfNecessary", QRVPlist::boolean(true))
                             .set("Transient", QRVPlist::boolean(false)));
  EXPECT_EQ(requests[1], QRVPlist::dictionary()
                             .set("Command", QRVPlist::uinteger(1))
                             .set("ContainerClass", QRVPlist::uinteger(2))
                             .set("Transient", QRVPlist::boolean(true)));
}

TEST_F(ContainerClientTest, CallsOnOneContainerSendItsUUIDAsData) {
  QRVContainerClient client = serve(7, [](const QRVPlist& request) {
    QRVPlist reply = success();
    switch (request.uint64ForKey("Command")) {
      case 6: reply.set("ReplyInfoValue", QRVPlist::uinteger(42)); break;
      case 7:
        reply.set("ReplyPath", QRVPlist::string("/m"))
            .set("ReplyTransient", QRVPlist::boolean(true))
            .set("ReplyInfoDictionary", QRVPlist::dictionary().set("k", QRVPlist::uinteger(42)));
        break;
      case 23: reply.set("ReplyDiskUsage", QRVPlist::uinteger(4096)); break;
      case 9: reply.set("ReplyError", QRVPlist::uinteger(21)); break;
    }
    return reply;
  });
  QRVContainerRef c{"com.example.a", 2, std::nullopt, kUUID};
  QRVClientError error;
  ASSERT_TRUE(client.setInfoValue(c, "k", QRVPlist::uinteger(42), &error)) << error.message;
  auto info = client.infoValueForKey(c, "k", &error);
  ASSERT_TRUE(info);
  EXPECT_EQ(info->infoValue, QRVPlist::uinteger(42));
  auto metadata = client.containerMetadata(c, true, &error);
  ASSERT_TRUE(metadata);
  EXPECT_EQ(metadata->path, "/m");
  EXPECT_EQ(metadata->transient, true);
  ASSERT_TRUE(metadata->infoDictionary);
  EXPECT_EQ(metadata->infoDictionary->uint64ForKey("k"), 42u);
  auto usage = client.diskUsage(c, &error);
  ASSERT_TRUE(usage);
  EXPECT_EQ(usage->diskUsage, 4096u);
  ASSERT_TRUE(client.recreateDefaultStructure(c, &error));
  auto regenerate = client.regenerateDirectoryUUID(c, &error);
  ASSERT_TRUE(regenerate);
  EXPECT_FALSE(regenerate->ok());
  EXPECT_EQ(regenerate->code, 21u);
  ASSERT_TRUE(client.deleteContainerContent(c, &error));

  const auto& requests = served();
  ASSERT_EQ(requests.size(), 7u);
  const uint64_t expected[] = {5, 6, 7, 23, 8, 9, 12};
  for (size_t i = 0; i < requests.size(); i++) {
    SCOPED_TRACE(i);
    EXPECT_EQ(requests[i].uint64ForKey("Command"), expected[i]);
    EXPECT_EQ(requests[i].stringForKey("Identifier"), "com.example.a");
    EXPECT_EQ(requests[i].uint64ForKey("ContainerClass"), 2u);
    EXPECT_EQ(*requests[i].get("UUID"), uuidData(kUUID));
    EXPECT_EQ(requests[i].get("PersonaUniqueString"), nullptr);
  }
  EXPECT_EQ(*requests[0].get("Value"), QRVPlist::uinteger(42));
  EXPECT_EQ(requests[1].stringForKey("Key"), "k");
  EXPECT_EQ(*requests[2].get("InfoDictRequested"), QRVPlist::boolean(true));
}

TEST_F(ContainerClientTest, DeleteReplaceAndHousekeepingRequests) {
  QRVContainerClient client = serve(10, [](const QRVPlist& request) {
    QRVPlist reply = success();
    uint64_t command = request.uint64ForKey("Command");
    if (command == 26) reply.set("ReplyPath", QRVPlist::string("/staged"));
    if (command == 28) reply.set("ReplyPath", QRVPlist::string("/assets")).set("ReplyExisted", QRVPlist::boolean(true));
    return reply;
  });
  QRVClientError error;
  QRVContainerRef oldC{"old", 2, std::nullopt, kUUID}, newC{"new", 2, std::nullopt, kOtherUUID};
  ASSERT_TRUE(client.replaceContainer(oldC, newC, &error)) << error.message;
  ASSERT_TRUE(client.stageContainersForDelete({{"a", 2, kUUID, ""}, {"b", 7, kOtherUUID, "P"}}, &error));
  ASSERT_TRUE(client.deleteContainersOnDeathRow(&error));
  ASSERT_TRUE(client.deleteContainer({"a", 2, std::nullopt, std::nullopt}, true, &error));
  ASSERT_TRUE(client.wipeContainerContent({"a", 4, std::nullopt, std::nullopt}, &error));
  auto staged = client.stageSharedContent("a", "/src", "dst", &error);
  ASSERT_TRUE(staged);
  EXPECT_EQ(staged->path, "/staged");
  auto assets = client.userManagedAssetsPath("a", std::string("P"), true, false, &error);
  ASSERT_TRUE(assets);
  EXPECT_EQ(assets->path, "/assets");
  EXPECT_EQ(assets->existed, true);
  ASSERT_TRUE(client.deleteUserManagedAsset("a", std::nullopt, "x/y", &error));
  ASSERT_TRUE(client.retryTest(3, &error));
  ASSERT_TRUE(client.setTestLock(2, true, &error));

  const auto& r = served();
  ASSERT_EQ(r.size(), 10u);
  EXPECT_EQ(r[0], QRVPlist::dictionary()
                      .set("Command", QRVPlist::uinteger(2))
                      .set("OldIdentifier", QRVPlist::string("old"))
                      .set("OldContainerClass", QRVPlist::uinteger(2))
                      .set("OldContainerUUID", uuidData(kUUID))
                      .set("NewIdentifier", QRVPlist::string("new"))
                      .set("NewContainerClass", QRVPlist::uinteger(2))
                      .set("NewContainerUUID", uuidData(kOtherUUID)));
  EXPECT_EQ(r[1].uint64ForKey("Command"), 3u);
  EXPECT_EQ(r[1].arrayForKey("IdentifiersArray"), (QRVPlist::Array{QRVPlist::string("a"), QRVPlist::string("b")}));
  EXPECT_EQ(r[1].arrayForKey("ContainerClassesArray"), (QRVPlist::Array{QRVPlist::uinteger(2), QRVPlist::uinteger(7)}));
  EXPECT_EQ(r[1].arrayForKey("UUIDsArray"), (QRVPlist::Array{uuidData(kUUID), uuidData(kOtherUUID)}));
  EXPECT_EQ(r[1].arrayForKey("PersonaUniqueStringsArray"), (QRVPlist::Array{QRVPlist::string(""), QRVPlist::string("P")}));
  EXPECT_EQ(r[2], QRVPlist::dictionary().set("Command", QRVPlist::uinteger(4)));
  EXPECT_EQ(r[3].uint64ForKey("Command"), 10u);
  EXPECT_TRUE(r[3].boolForKey("Transient"));
  EXPECT_EQ(r[4].uint64ForKey("Command"), 11u);
  EXPECT_EQ(r[5], QRVPlist::dictionary()
                      .set("Command", QRVPlist::uinteger(26))
                      .set("Identifier", QRVPlist::string("a"))
                      .set("SourcePath", QRVPlist::string("/src"))
                      .set("DestPath", QRVPlist::string("dst")));
  EXPECT_EQ(r[6], QRVPlist::dictionary()
                      .set("Command", QRVPlist::uinteger(28))
                      .set("Identifier", QRVPlist::string("a"))
                      .set("PersonaUniqueString", QRVPlist::string("P"))
                      .set("IsRelative", QRVPlist::boolean(true))
                      .set("CreateIfNecessary", QRVPlist::boolean(false)));
  EXPECT_EQ(r[7].uint64ForKey("Command"), 29u);
  EXPECT_EQ(r[7].stringForKey("SourcePath"), "x/y");
  EXPECT_EQ(r[8], QRVPlist::dictionary().set("Command", QRVPlist::uinteger(25)).set("NumRetryCrashes", QRVPlist::uinteger(3)));
  EXPECT_EQ(r[9], QRVPlist::dictionary()
                      .set("Command", QRVPlist::uinteger(31))
                      .set("TestLock", QRVPlist::uinteger(2))
                      .set("Enable", QRVPlist::boolean(true)));
}

TEST_F(ContainerClientTest, MalformedReplyFieldsStayEmptyAndNoReplyIsAnError) {
  QRVContainerClient client = serve(1, [](const QRVPlist&) {
    // Wrong types: a string UUID, a numeric path, a short data UUID in the list.
    return success()
        .set("ReplyUUID", QRVPlist::string("not data"))
        .set("ReplyPath", QRVPlist::uinteger(3))
        .set("ReplyUUIDsArray", QRVPlist::array({QRVPlist::data({1, 2})}));
  });
  QRVClientError error;
  auto result = client.createOrLookupContainer({"a", 2, std::nullopt, std::nullopt}, false, false, &error);
  ASSERT_TRUE(result);
  EXPECT_FALSE(result->uuid);
  EXPECT_FALSE(result->path);
  EXPECT_TRUE(result->uuids.empty());
  served();
  // The server has hung up: the next call fails with a client error.
  EXPECT_FALSE(client.diskUsage({"a", 2, std::nullopt, kUUID}, &error));
  EXPECT_NE(error.errnum, 0);
}

}  // namespace

// The client library against a real peer: one end of a socketpair (or a
// listening socket in a temporary root) plays the daemon, byte for byte.
#include "client/QRVClient.h"

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <thread>

#include "base/QRVWireFrame.h"
#include "client/QRVReplyFormat.h"
#include "client/QRVRequestArguments.h"

using namespace std::chrono_literals;
namespace fs = std::filesystem;

namespace {

// The daemon's end of a connection, with blocking I/O.
class FakeDaemon {
 public:
  explicit FakeDaemon(int fd) : fd_(fd) {}
  ~FakeDaemon() { hangUp(); }

  struct Request {
    QRVWireFrame::Header header;
    QRVPlist body;
  };
  Request readRequest() {
    uint8_t header[QRVWireFrame::kHeaderSize];
    readExactly(header, sizeof(header));
    Request request{QRVWireFrame::decodeHeader(header), {}};
    std::vector<uint8_t> body(request.header.length);
    readExactly(body.data(), body.size());
    request.body = QRVWireFrame::decodeBody(body.data(), body.size()).value_or(QRVPlist());
    return request;
  }
  void reply(uint64_t messageId, QRVPlist body) {
    writeRaw(QRVWireFrame::encode(body, 0, messageId));
  }
  void writeRaw(const std::vector<uint8_t>& bytes) {
    ASSERT_EQ(::write(fd_, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
  }
  void hangUp() {
    if (fd_ >= 0) close(fd_);
    fd_ = -1;
  }

 private:
  void readExactly(uint8_t* p, size_t n) {
    while (n > 0) {
      ssize_t r = ::read(fd_, p, std::min<size_t>(n, 8192));
      ASSERT_GT(r, 0) << "client hung up";
      p += r;
      n -= static_cast<size_t>(r);
    }
  }
  int fd_;
};

QRVPlist replyNamed(const std::string& name, uint64_t code = 1) {
  QRVPlist reply = QRVPlist::dictionary();
  reply.set("ReplyError", QRVPlist::uinteger(code));
  reply.set("ReplyIdentifier", QRVPlist::string(name));
  return reply;
}

QRVPlist command(uint64_t number) {
  QRVPlist request = QRVPlist::dictionary();
  request.set("Command", QRVPlist::uinteger(number));
  return request;
}

class QRVClientTest : public ::testing::Test {
 protected:
  void SetUp() override {
    int fds[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
    client_.emplace(QRVClient::adoptSocket(fds[0], "test daemon"));
    daemon_.emplace(fds[1]);
  }
  std::optional<QRVClient> client_;
  std::optional<FakeDaemon> daemon_;
  QRVClientError error_;
};

}  // namespace

// --- replies are matched by message id ---------------------------------------

TEST_F(QRVClientTest, RepliesAnsweredOutOfOrderReachTheirRequests) {
  std::vector<uint64_t> ids;
  for (uint64_t n : {0, 21, 4}) ids.push_back(client_->send(command(n), 1s, &error_).value());
  std::vector<FakeDaemon::Request> requests;
  for (int i = 0; i < 3; i++) requests.push_back(daemon_->readRequest());
  for (size_t i = 0; i < 3; i++) {
    EXPECT_EQ(requests[i].header.messageId, ids[i]);
    EXPECT_TRUE(requests[i].header.flags & QRVWireFrame::kFlagWantsReply);
  }
  EXPECT_EQ(requests[1].body.uint64ForKey("Command"), 21u);
  daemon_->reply(ids[2], replyNamed("third"));
  daemon_->reply(ids[0], replyNamed("first"));
  daemon_->reply(ids[1], replyNamed("second", 61));

  auto second = client_->receiveReply(ids[1], 1s, &error_);
  ASSERT_TRUE(second) << error_.message;
  EXPECT_EQ(second->stringForKey("ReplyIdentifier"), "second");
  EXPECT_EQ(QRVClient::resultCode(*second), 61u);
  // The two replies read on the way were kept, in arrival order.
  auto next = client_->receive(1s, &error_);
  ASSERT_TRUE(next);
  EXPECT_EQ(next->messageId, ids[2]);
  EXPECT_EQ(client_->receiveReply(ids[0], 1s, &error_)->stringForKey("ReplyIdentifier"), "first");
}

TEST_F(QRVClientTest, LargeRequestIsWrittenWholeThroughPartialWrites) {
  QRVPlist request = command(18);
  request.set("CodeSigningInfo", QRVPlist::data(QRVPlist::Bytes(4 << 20, 0xA5)));
  QRVPlist received;
  std::thread daemon([&] {
    auto r = daemon_->readRequest();
    received = r.body;
    daemon_->reply(r.header.messageId, replyNamed("ok"));
  });
  auto reply = client_->sendRequest(request, 5s, &error_);
  daemon.join();
  ASSERT_TRUE(reply) << error_.message;
  EXPECT_EQ(received, request);
}

// --- timeouts ----------------------------------------------------------------

TEST_F(QRVClientTest, TimeoutWaitingForReplyKeepsConnectionAndPartialReply) {
  auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(client_->sendRequest(command(0), 100ms, &error_));
  auto waited = std::chrono::steady_clock::now() - start;
  EXPECT_EQ(error_.errnum, ETIMEDOUT);
  EXPECT_GE(waited, 100ms);
  EXPECT_LT(waited, 2s);
  EXPECT_FALSE(client_->isBroken());

  // Half a reply, another timeout, then the rest: the frame is completed.
  uint64_t id = daemon_->readRequest().header.messageId;
  auto frame = QRVWireFrame::encode(replyNamed("late"), 0, id);
  std::vector<uint8_t> head(frame.begin(), frame.begin() + 20),
      tail(frame.begin() + 20, frame.end());
  daemon_->writeRaw(head);
  EXPECT_FALSE(client_->receiveReply(id, 50ms, &error_));
  EXPECT_EQ(error_.errnum, ETIMEDOUT);
  daemon_->writeRaw(tail);
  auto reply = client_->receiveReply(id, 1s, &error_);
  ASSERT_TRUE(reply) << error_.message;
  EXPECT_EQ(reply->stringForKey("ReplyIdentifier"), "late");
}

TEST_F(QRVClientTest, OversizeRequestIsRefusedAndATimeoutPartWayThroughSendingBreaksConnection) {
  QRVPlist request = command(18);
  request.set("CodeSigningInfo", QRVPlist::data(QRVPlist::Bytes(QRVWireFrame::kMaxBodySize, 0)));
  EXPECT_FALSE(client_->send(request, 1s, &error_));
  EXPECT_EQ(error_.errnum, EMSGSIZE);
  EXPECT_FALSE(client_->isBroken());

  request.set("CodeSigningInfo", QRVPlist::data(QRVPlist::Bytes(8 << 20, 1)));
  EXPECT_FALSE(client_->send(request, 100ms, &error_));  // nobody reads
  EXPECT_EQ(error_.errnum, ETIMEDOUT);
  EXPECT_TRUE(client_->isBroken());
  EXPECT_FALSE(client_->send(command(0), 100ms, &error_));
  EXPECT_EQ(error_.errnum, ENOTCONN);
}

// --- the daemon hangs up or misbehaves -----------------------------------------

TEST_F(QRVClientTest, DaemonClosingBeforeOrDuringReplyIsReported) {
  uint64_t id = client_->send(command(0), 1s, &error_).value();
  daemon_->readRequest();
  auto frame = QRVWireFrame::encode(replyNamed("cut"), 0, id);
  daemon_->writeRaw({frame.begin(), frame.begin() + 21});
  daemon_->hangUp();
  EXPECT_FALSE(client_->receiveReply(id, 1s, &error_));
  EXPECT_EQ(error_.errnum, ECONNRESET);
  EXPECT_NE(error_.message.find("in the middle of a reply"), std::string::npos) << error_.message;
  EXPECT_FALSE(client_->receive(1s, &error_));
  EXPECT_EQ(error_.errnum, ENOTCONN);
}

TEST_F(QRVClientTest, SendingToClosedDaemonFailsWithoutSignal) {
  daemon_->hangUp();
  // Without MSG_NOSIGNAL this would kill the test with SIGPIPE.
  EXPECT_FALSE(client_->sendRequest(command(0), 1s, &error_));
  EXPECT_EQ(error_.errnum, ECONNRESET);
  EXPECT_NE(error_.message.find("closed the connection"), std::string::npos) << error_.message;
}

TEST(QRVClientMalformedReply, IsAnErrorThatBreaksConnection) {
  QRVWireFrame::Header oversized{QRVWireFrame::kMaxBodySize + 1, 0, 1};
  std::vector<uint8_t> oversizedFrame(QRVWireFrame::kHeaderSize);
  QRVWireFrame::encodeHeader(oversized, oversizedFrame.data());
  std::vector<uint8_t> garbage(QRVWireFrame::kHeaderSize + 12, 0x5A);
  QRVWireFrame::encodeHeader({12, 0, 1}, garbage.data());
  QRVPlist notDictionary = QRVPlist::array({QRVPlist::uinteger(1)});
  auto arrayBody = notDictionary.toBinary();
  std::vector<uint8_t> arrayFrame(QRVWireFrame::kHeaderSize);
  QRVWireFrame::encodeHeader({static_cast<uint32_t>(arrayBody.size()), 0, 1}, arrayFrame.data());
  arrayFrame.insert(arrayFrame.end(), arrayBody.begin(), arrayBody.end());

  for (const auto& bytes : {oversizedFrame, garbage, arrayFrame}) {
    int fds[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
    QRVClient client = QRVClient::adoptSocket(fds[0]);
    FakeDaemon daemon(fds[1]);
    daemon.writeRaw(bytes);
    QRVClientError error;
    EXPECT_FALSE(client.receive(1s, &error));
    EXPECT_EQ(error.errnum, EBADMSG) << error.message;
    EXPECT_NE(error.message.find("malformed reply"), std::string::npos);
    EXPECT_TRUE(client.isBroken());
  }
}

// --- finding the daemon --------------------------------------------------------

TEST(QRVClientConnect, RootAndSocketPath) {
  EXPECT_EQ(QRVClient::socketPathForRoot("/"), "/run/quorvad/com.kelva.quorvad");
  EXPECT_EQ(QRVClient::socketPathForRoot(""), "/run/quorvad/com.kelva.quorvad");
  EXPECT_EQ(QRVClient::socketPathForRoot("/tmp/r//"), "/tmp/r/run/quorvad/com.kelva.quorvad");

  // The option beats the environment, which beats "/"; empty counts as unset.
  const char* saved = getenv("QUORVAD_ROOT");
  std::optional<std::string> restore = saved ? std::optional<std::string>(saved) : std::nullopt;
  setenv("QUORVAD_ROOT", "", 1);
  EXPECT_EQ(QRVClient::resolveRoot(std::nullopt), "/");
  setenv("QUORVAD_ROOT", "/env/root", 1);
  EXPECT_EQ(QRVClient::resolveRoot(std::nullopt), "/env/root");
  EXPECT_EQ(QRVClient::resolveRoot("/option/root"), "/option/root");
  restore ? setenv("QUORVAD_ROOT", restore->c_str(), 1) : unsetenv("QUORVAD_ROOT");
}

TEST(QRVClientConnect, AbsentDaemonAndRealSocket) {
  char pattern[] = "/tmp/qrvclient.XXXXXX";
  ASSERT_TRUE(mkdtemp(pattern));
  std::string root = pattern;
  std::string path = QRVClient::socketPathForRoot(root);
  QRVClientError error;

  EXPECT_FALSE(QRVClient::connect(root, &error));
  EXPECT_EQ(error.errnum, ENOENT);
  EXPECT_EQ(error.message, "quorvad is not running (no socket at " + path + ")");
  EXPECT_TRUE(error.daemonNotRunning());

  // A socket file left behind by a daemon that is gone: bound, not listening.
  fs::create_directories(fs::path(path).parent_path());
  int listener = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  strcpy(address.sun_path, path.c_str());
  ASSERT_EQ(bind(listener, reinterpret_cast<sockaddr*>(&address), sizeof(address)), 0);
  EXPECT_FALSE(QRVClient::connect(root, &error));
  EXPECT_EQ(error.errnum, ECONNREFUSED);
  EXPECT_NE(error.message.find("quorvad is not running"), std::string::npos) << error.message;

  ASSERT_EQ(listen(listener, 4), 0);
  std::thread daemon([&] {
    FakeDaemon peer(accept(listener, nullptr, nullptr));
    auto request = peer.readRequest();
    peer.reply(request.header.messageId, replyNamed(request.body.stringForKey("Identifier")));
  });
  auto client = QRVClient::connect(root, &error);
  ASSERT_TRUE(client) << error.message;
  std::string parseError;
  auto request = QRVRequestArguments::buildRequest(0, {"Identifier=com.example.app"}, &parseError);
  auto reply = client->sendRequest(request.value(), 2s, &error);
  daemon.join();
  ASSERT_TRUE(reply) << error.message;
  EXPECT_EQ(reply->stringForKey("ReplyIdentifier"), "com.example.app");
  close(listener);

  EXPECT_FALSE(QRVClient::connectToSocket("/" + std::string(200, 'x'), &error));
  EXPECT_EQ(error.errnum, ENAMETOOLONG);
  fs::remove_all(root);
}

// --- KEY=VALUE words -----------------------------------------------------------

TEST(QRVRequestArgumentsTest, ValuesAreGuessedOrTakenAsTyped) {
  std::string xmlPath = fs::temp_directory_path() / "qrvclient-test-value.plist";
  QRVPlist fileValue = QRVPlist::dictionary().set("Nested", QRVPlist::boolean(true));
  std::ofstream(xmlPath) << fileValue.toXML();
  auto s = [](const char* text) { return QRVPlist::string(text); };
  const std::vector<std::pair<std::string, QRVPlist>> cases = {
      // Untyped: digits are numbers, true/false booleans, the rest text.
      {"K=42", QRVPlist::uinteger(42)}, {"K=18446744073709551615", QRVPlist::uinteger(UINT64_MAX)},
      {"K=true", QRVPlist::boolean(true)}, {"K=false", QRVPlist::boolean(false)},
      {"K=com.example.app", s("com.example.app")}, {"K=", s("")}, {"K=-5", s("-5")}, {"K=a=b", s("a=b")},
      {"K:uint=0x1F", QRVPlist::uinteger(31)}, {"K:bool=yes", QRVPlist::boolean(true)}, {"K:str=123", s("123")},
      {"K:data=00ff10", QRVPlist::data({0x00, 0xFF, 0x10})},
      {"K:uuid=00112233-4455-6677-8899-aabbccddeeff", QRVPlist::data({0x00, 0x11, 0x22, 0x33, 0x44, 0x55, 0x66, 0x77,
                                                                      0x88, 0x99, 0xAA, 0xBB, 0xCC, 0xDD, 0xEE, 0xFF})},
      {"K:strs=a,,c", QRVPlist::array({s("a"), s(""), s("c")})}, {"K:strs=", QRVPlist::array()},
      {"K:uints=1,2", QRVPlist::array({QRVPlist::uinteger(1), QRVPlist::uinteger(2)})},
      {"K:plist=@" + xmlPath, fileValue}};
  for (const auto& [word, value] : cases) {
    std::string error;
    auto parsed = QRVRequestArguments::parseArgument(word, &error);
    ASSERT_TRUE(parsed) << word << ": " << error;
    EXPECT_EQ(parsed->first, "K") << word;
    EXPECT_EQ(parsed->second, value) << word;
  }
  fs::remove(xmlPath);
  std::string error;
  EXPECT_EQ(QRVRequestArguments::buildRequest(13, {"Count=42", "Identifier=a"}, &error),
            command(13).set("Count", QRVPlist::uinteger(42)).set("Identifier", s("a")));
}

TEST(QRVRequestArgumentsTest, MalformedWordsAreRejectedByName) {
  for (const char* word :
       {"NoEquals", "=1", ":uint=1", "K:uint=abc", "K:uint=18446744073709551616",
        "K=18446744073709551616", "K:bool=maybe", "K:data=abc", "K:data=zz", "K:uuid=1234",
        "K:uints=1,x", "K:float=1.5", "K:plist=<notxml", "K:plist=@/nonexistent/file.plist"}) {
    std::string error;
    EXPECT_FALSE(QRVRequestArguments::parseArgument(word, &error)) << word;
    EXPECT_NE(error.find(word), std::string::npos) << error;
  }
  std::string error;
  EXPECT_FALSE(QRVRequestArguments::buildRequest(0, {"Key=1", "Key:str=x"}, &error));
  EXPECT_NE(error.find("more than once"), std::string::npos);
  EXPECT_FALSE(QRVRequestArguments::buildRequest(0, {"Command=3"}, &error));
}

// --- rendering replies ---------------------------------------------------------

TEST(QRVReplyFormatTest, JSONStringsAreEscapedAndValidUTF8) {
  struct Case {
    std::string in, out;
  };
  for (const auto& c : std::vector<Case>{
           {"plain", R"("plain")"},
           {"q\"b\\s/", R"("q\"b\\s/")"},
           {"\n\r\t\b\f", R"("\n\r\t\b\f")"},
           {std::string("\x01\x1f\x7f", 3), R"("\u0001\u001f\u007f")"},
           {std::string("nul\0in", 6), R"("nul\u0000in")"},
           {"caf\xc3\xa9 \xf0\x9f\x93\xa6", "\"caf\xc3\xa9 \xf0\x9f\x93\xa6\""},
           {"bad\xff", R"("bad\ufffd")"},
           {"\xc0\xaf", R"("\ufffd\ufffd")"},            // overlong '/'
           {"\xed\xa0\x80", R"("\ufffd\ufffd\ufffd")"},  // surrogate
           {"\xe2\x82", R"("\ufffd\ufffd")"},            // truncated
       })
    EXPECT_EQ(QRVReplyFormat::jsonString(c.in), c.out);
}

TEST(QRVReplyFormatTest, WholeReplies) {
  QRVPlist reply = replyNamed("com.example.\"app\"");
  reply.set("ReplyUUID", QRVPlist::data(QRVPlist::Bytes(16, 0xAB)));
  reply.set("ReplyExisted", QRVPlist::boolean(false));
  reply.set("ReplyIdsArray", QRVPlist::array({QRVPlist::string("a"), QRVPlist::string("b")}));
  reply.set("ReplyPath", QRVPlist::string("line\nbreak"));
  EXPECT_EQ(QRVReplyFormat::json(reply, 0),
            R"({"ReplyError": 1, "ReplyExisted": false, "ReplyIdentifier": "com.example.\"app\"", )"
            R"("ReplyIdsArray": ["a", "b"], "ReplyPath": "line\nbreak", )"
            R"("ReplyUUID": "abababababababababababababababab"})");
  EXPECT_EQ(QRVReplyFormat::human(reply),
            "ReplyError = 1 (success)\n"
            "ReplyExisted = false\n"
            "ReplyIdentifier = com.example.\"app\"\n"
            "ReplyIdsArray = (\"a\", \"b\")\n"
            "ReplyPath = \"line\\nbreak\"\n"
            "ReplyUUID = ABABABAB-ABAB-ABAB-ABAB-ABABABABABAB\n");
  EXPECT_EQ(QRVReplyFormat::human(replyNamed("x", 55)).substr(0, 37),
            "ReplyError = 55 (caller not entitled)");
  EXPECT_EQ(QRVReplyFormat::human(replyNamed("x", 999)).substr(0, 38),
            "ReplyError = 999 (unknown result code)");
}

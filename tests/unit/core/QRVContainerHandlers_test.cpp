// The container commands through the real dispatcher and handlers, as a
// client's request reaches them: what the reply carries and which code a
// request answers.
#include "core/QRVContainerHandlers.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

#include "base/QRVLog.h"
#include "core/QRVCommandTable.h"
#include "core/QRVRelayDispatcher.h"
#include "support/QRVRequests.h"
#include "support/QRVTestConnection.h"
#include "support/QRVTestServices.h"

namespace {

constexpr pid_t kInstaller = 700;

class ContainerHandlersTest : public testing::Test {
 protected:
  ContainerHandlersTest() {
    env_.trustStore->setClient(kInstaller, {"com.example.installer", QRVEntitlements({"allowed"})});
  }
  // The one reply to `request` sent by the installer.
  QRVPlist send(const QRVPlist& request) {
    QRVRelayDispatcher dispatcher(env_.services, QRVDefaultCommandTable());
    auto connection = std::make_shared<QRVTestConnection>(kInstaller);
    dispatcher.QRVProcessRelayEvent(connection, connection->message(request));
    EXPECT_EQ(connection->replies.size(), 1u);
    return connection->replies.empty() ? QRVPlist::dictionary() : connection->replies[0].second;
  }
  static uint64_t code(const QRVPlist& reply) { return reply.uint64ForKey("ReplyError"); }
  static QRVPlist withUUID(QRVPlist request, const QRVPlist::Bytes& uuid) {
    return request.set("UUID", QRVPlist::data(uuid));
  }

  QRVTestServices env_;
};

TEST_F(ContainerHandlersTest, TokensCarryTheExtensionClassOfTheContainerClass) {
  // The fake sandbox's token is "<extension class>;<path>".
  struct {
    uint64_t containerClass;
    const char* extensionClass;
  } cases[] = {{2, "com.kelva.sandbox.container"},
               {7, "com.kelva.sandbox.application-group"},
               {12, "com.kelva.sandbox.container"}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.containerClass);
    QRVPlist created = send(QRVCreateRequest("com.example.shared", c.containerClass));
    ASSERT_EQ(code(created), 1u);
    const std::string path = created.stringForKey("ReplyPath");
    EXPECT_EQ(created.stringForKey("SandboxToken"), std::string(c.extensionClass) + ";" + path);
    // The metadata command hands out the same kind of token.
    QRVPlist metadata =
        send(withUUID(QRVCreateRequest("com.example.shared", c.containerClass).set("Command", QRVPlist::uinteger(7)),
                      created.dataForKey("ReplyUUID")));
    ASSERT_EQ(code(metadata), 1u);
    EXPECT_EQ(metadata.stringForKey("SandboxToken"), std::string(c.extensionClass) + ";" + path);
  }
}

TEST_F(ContainerHandlersTest, UUIDsThatNameNoContainerAnswer21AndDataThatIsNoUUIDAnswers11) {
  QRVPlist created = send(QRVCreateRequest("com.example.app", 2));
  ASSERT_EQ(code(created), 1u);
  QRVPlist metadata = QRVCreateRequest("com.example.app", 2).set("Command", QRVPlist::uinteger(7));
  EXPECT_EQ(code(send(withUUID(metadata, created.dataForKey("ReplyUUID")))), 1u);
  EXPECT_EQ(code(send(withUUID(metadata, QRVPlist::Bytes(16, 0)))), 21u);  // the all-zero UUID
  EXPECT_EQ(code(send(withUUID(metadata, QRVPlist::Bytes(16, 0xAB)))), 21u);
  EXPECT_EQ(code(send(withUUID(metadata, QRVPlist::Bytes(15, 0xAB)))), 11u);
  EXPECT_EQ(code(send(metadata)), 11u);  // no UUID at all
}

TEST_F(ContainerHandlersTest, RecreatingTheStructureAgainIsTheSameCommandAndNoCommandIsCommandZero) {
  QRVPlist created = send(QRVCreateRequest("com.example.app", 2));
  ASSERT_EQ(code(created), 1u);
  const std::string path = created.stringForKey("ReplyPath");
  for (uint64_t command : {8, 22}) {
    SCOPED_TRACE(command);
    std::filesystem::remove_all(path + "/Library");
    QRVPlist recreate = QRVCreateRequest("com.example.app", 2).set("Command", QRVPlist::uinteger(command));
    EXPECT_EQ(code(send(withUUID(recreate, created.dataForKey("ReplyUUID")))), 1u);
    EXPECT_TRUE(std::filesystem::is_directory(path + "/Library/Caches"));
    EXPECT_EQ(code(send(withUUID(recreate, QRVPlist::Bytes(16, 0xAB)))), 21u);
  }
  // A request without "Command" is a create-or-lookup.
  QRVPlist noCommand = QRVCreateRequest("com.example.app", 2);
  noCommand.remove("Command");
  QRVPlist found = send(noCommand);
  EXPECT_EQ(code(found), 1u);
  EXPECT_EQ(found.stringForKey("ReplyPath"), path);
  EXPECT_TRUE(found.boolForKey("ReplyExisted"));
}

TEST_F(ContainerHandlersTest, ALookUpThatFindsNothingLogsNoError) {
  const std::string logPath = env_.root.path() + "/handlers.log";
  QRVLog::open("com.kelva.quorvad", logPath, QRVLogLevel::kNotice, 1, 1 << 20);
  EXPECT_EQ(code(send(QRVCreateRequest("com.example.absent", 2, /*transient=*/false, /*createIfNecessary=*/false))),
            21u);
  QRVLog::close();
  std::stringstream log;
  log << std::ifstream(logPath).rdbuf();
  EXPECT_EQ(log.str().find("com.example.absent"), std::string::npos) << log.str();
}

}  // namespace

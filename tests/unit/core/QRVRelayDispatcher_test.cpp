#include "core/QRVRelayDispatcher.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <set>
#include <sstream>
#include <stdexcept>
#include <string>

#include "base/QRVLog.h"
#include "base/QRVResultCode.h"
#include "operations/QRVClientConnection.h"
#include "support/QRVTestConnection.h"
#include "support/QRVTestServices.h"

namespace {

// What the handler saw of the connection the dispatcher built.
struct Seen {
  bool called = false;
  bool entitled = false, allowOtherIdLookup = false, unrestricted = false, hasLookup = false;
  std::optional<QRVPlist::Array> wipeList;
};
Seen gSeen;
uint64_t gHandlerResult = 1;

void recordingHandler(const QRVPlist&, const std::shared_ptr<QRVReply>&, QRVClientConnection& c, uint64_t* result) {
  gSeen = {true, c.isEntitled(), c.allowOtherIdLookup(), c.isUnrestricted(), c.lookup().has_value(),
           c.entitledWipeIdentifiers()};
  if (gHandlerResult != 1) *result = gHandlerResult;
}

// The daemon's table with a recording handler for every command but the
// retired one.
QRVCommandTable recordingTable() {
  QRVCommandTable t = QRVDefaultCommandTable();
  for (auto& e : t) e.handler = e.command == 27 ? nullptr : recordingHandler;
  return t;
}

QRVPlist entitlement(const char* name, QRVPlist value = QRVPlist::boolean(true)) {
  return QRVPlist::dictionary().set(name, std::move(value));
}
QRVPlist command(uint64_t c) { return QRVPlist::dictionary().set("Command", QRVPlist::uinteger(c)); }

// The right that grants each command, written out here rather than read from
// the table under test, so that a wrong table entry fails.
const char* const kGrantingRight[kQRVCommandCount] = {
    "allowed", "allowed", "allowed", "allowed", "userManagedAssets",  // 0-4
    "allowed", "allowed", "allowed", "allowed", "allowed",            // 5-9
    "allowed", "wipeContainer", "deleteContainerContent", "allowed", "allowed",  // 10-14
    "allowed", "allowed", "allowed", "allowed", "allowed",  // 15-19
    "allowed", "allowed", "allowed", "allowed", "dataMigration",  // 20-24
    "testability", "stageSharedContent", "allowed", "userManagedAssets", "userManagedAssets",  // 25-29
    "allowed", "testability",  // 30-31
};
std::string grantingEntitlement(uint64_t c) { return std::string("com.kelva.private.Quorva.") + kGrantingRight[c]; }

class RelayDispatcherTest : public testing::Test {
 protected:
  void SetUp() override {
    gSeen = {};
    gHandlerResult = 1;
  }
  void setClient(pid_t pid, QRVPlist entitlements) {
    env_.trustStore->setClient(pid, {"com.example.client" + std::to_string(pid), std::move(entitlements)});
  }
  // Sends `body` from `pid` through a fresh dispatcher; returns the replies.
  std::vector<std::pair<uint64_t, QRVPlist>> send(pid_t pid, QRVPlist body, bool wantsReply = true) {
    gSeen = {};
    QRVRelayDispatcher dispatcher(env_.services, table_);
    if (processor_) dispatcher.setRegisteredEntitlementsProcessor(processor_);
    auto connection = std::make_shared<QRVTestConnection>(pid);
    dispatcher.QRVProcessRelayEvent(connection, connection->message(std::move(body), 7, wantsReply));
    cancelled_ = connection->cancelled;
    return connection->replies;
  }
  // The result code of the one reply, 0 when there was none.
  uint64_t resultOf(pid_t pid, uint64_t c) {
    auto replies = send(pid, command(c));
    EXPECT_LE(replies.size(), 1u) << "command " << c;
    if (replies.size() != 1) return 0;
    EXPECT_EQ(replies[0].first, 7u);
    return replies[0].second.uint64ForKey("ReplyError");
  }

  QRVTestServices env_;
  QRVCommandTable table_ = recordingTable();
  QRVRelayDispatcher::RegisteredEntitlementsProcessor processor_;
  bool cancelled_ = false;
};

TEST_F(RelayDispatcherTest, CallersWithoutEntitlementsRunOnlyTheOpenCommandsRestricted) {
  const std::set<uint64_t> open = {0, 13, 15, 16, 17, 28};
  setClient(100, QRVPlist::dictionary());
  // 600 is unknown to the trust store (no signing identifier); 601's
  // entitlements cannot be read, which reads as none.
  env_.trustStore->setClient(601, {"com.example.noents", std::nullopt});
  for (pid_t pid : {100, 600, 601}) {
    for (uint64_t c = 0; c < kQRVCommandCount; c++) {
      if (c == 27) continue;
      SCOPED_TRACE(testing::Message() << "pid " << pid << " command " << c);
      uint64_t result = resultOf(pid, c);
      if (open.count(c)) {
        EXPECT_EQ(result, 1u);
        EXPECT_TRUE(gSeen.called);
        EXPECT_FALSE(gSeen.entitled || gSeen.unrestricted || gSeen.allowOtherIdLookup || gSeen.hasLookup);
      } else {
        EXPECT_EQ(result, 55u);
        EXPECT_FALSE(gSeen.called);
      }
    }
  }
}

TEST_F(RelayDispatcherTest, AllowedCallerIsUnrestrictedExceptForTestCommands) {
  setClient(101, entitlement(kEntitlementAllowed));
  for (uint64_t c = 0; c < kQRVCommandCount; c++) {
    if (c == 27) continue;
    SCOPED_TRACE(c);
    uint64_t result = resultOf(101, c);
    if (c == 25 || c == 31) {  // the test commands
      EXPECT_EQ(result, 55u);
    } else {
      // 4 and 21 answer from their own completion: no reply here.
      EXPECT_EQ(result, c == 4 || c == 21 ? 0u : 1u);
      EXPECT_TRUE(gSeen.entitled && gSeen.unrestricted && gSeen.allowOtherIdLookup);
      EXPECT_FALSE(gSeen.hasLookup);
    }
  }
  // With the testability right as well, test commands run, still restricted.
  setClient(102, entitlement(kEntitlementAllowed).set(kEntitlementTestability, QRVPlist::boolean(true)));
  for (uint64_t c : {25, 31}) {
    EXPECT_EQ(resultOf(102, c), 1u);
    EXPECT_TRUE(gSeen.entitled);
    EXPECT_FALSE(gSeen.unrestricted);
  }
}

TEST_F(RelayDispatcherTest, EachCommandIsGrantedByItsOwnEntitlement) {
  pid_t pid = 200;
  for (uint64_t c = 0; c < kQRVCommandCount; c++) {
    if (c == 27 || c == 11) continue;  // 11 takes a list, below
    setClient(++pid, entitlement(grantingEntitlement(c).c_str()));
    resultOf(pid, c);
    EXPECT_TRUE(gSeen.called && gSeen.entitled) << "command " << c;
    // Only "allowed" makes a caller unrestricted.
    EXPECT_EQ(gSeen.unrestricted, std::string(kGrantingRight[c]) == "allowed") << c;
  }
  // A number counts as a boolean; a string does not.
  setClient(300, entitlement(kEntitlementUserManagedAssets, QRVPlist::uinteger(1)));
  EXPECT_EQ(resultOf(300, 29), 1u);
  setClient(301, entitlement(kEntitlementUserManagedAssets, QRVPlist::string("yes")));
  EXPECT_EQ(resultOf(301, 29), 55u);

  // Wiping needs a list of identifiers (a boolean is not one) or an
  // unrestricted caller.
  QRVPlist list = QRVPlist::array({QRVPlist::string("com.example.a")});
  setClient(400, entitlement(kEntitlementWipeContainer, list));
  EXPECT_EQ(resultOf(400, 11), 1u);
  EXPECT_EQ(gSeen.wipeList, list.arrayValue());
  EXPECT_FALSE(gSeen.unrestricted);
  setClient(401, entitlement(kEntitlementWipeContainer));
  EXPECT_EQ(resultOf(401, 11), 55u);
  setClient(402, entitlement(kEntitlementAllowed));
  EXPECT_EQ(resultOf(402, 11), 1u);
  EXPECT_FALSE(gSeen.wipeList.has_value());
  EXPECT_TRUE(gSeen.unrestricted);
}

TEST_F(RelayDispatcherTest, LookupDictionaryOpensOnlyTheLookupCommands) {
  const std::set<uint64_t> lookup = {0, 1, 13, 14, 15, 16, 17, 23};
  setClient(500, entitlement(kEntitlementLookup, QRVPlist::dictionary().set("com.example.a", QRVPlist::boolean(true))));
  for (uint64_t c = 0; c < kQRVCommandCount; c++) {
    if (c == 27 || c == 28) continue;  // 28 is open to everyone, without lookup
    SCOPED_TRACE(c);
    uint64_t result = resultOf(500, c);
    if (lookup.count(c)) {
      EXPECT_EQ(result, 1u);
      EXPECT_TRUE(gSeen.hasLookup);
      EXPECT_FALSE(gSeen.entitled);
    } else {
      EXPECT_EQ(result, 55u);
    }
  }
  // Other-identifier look-up is its own right.
  setClient(501, entitlement(kEntitlementOtherIdLookup));
  EXPECT_EQ(resultOf(501, 0), 1u);
  EXPECT_TRUE(gSeen.allowOtherIdLookup);
  EXPECT_FALSE(gSeen.entitled);
}

TEST_F(RelayDispatcherTest, InvalidCommandsAnswer49) {
  setClient(700, entitlement(kEntitlementAllowed));
  setClient(701, QRVPlist::dictionary());
  for (pid_t pid : {700, 701, 702}) {  // entitled, without entitlements, unknown to the trust store
    for (uint64_t c : {uint64_t{27}, uint64_t{32}, UINT64_MAX}) {  // 27 is retired: no handler
      EXPECT_EQ(resultOf(pid, c), 49u) << "pid " << pid << " command " << c;
      EXPECT_FALSE(gSeen.called);
    }
  }
  // An entry that does not describe its own index is refused.
  table_[5].command = 6;
  EXPECT_EQ(resultOf(700, 5), 49u);
  EXPECT_FALSE(gSeen.called);
  // An absent or mistyped "Command" is command 0.
  auto replies = send(700, QRVPlist::dictionary().set("Command", QRVPlist::string("5")));
  ASSERT_EQ(replies.size(), 1u);
  EXPECT_TRUE(gSeen.called);
  EXPECT_EQ(replies[0].second.uint64ForKey("ReplyError"), 1u);
}

TEST_F(RelayDispatcherTest, ExactlyOneReplyUnlessTheCommandAnswersLater) {
  setClient(800, entitlement(kEntitlementAllowed).set(kEntitlementUserManagedAssets, QRVPlist::boolean(true)));
  // 4 and 21 answer from their completion when they succeed...
  for (uint64_t c : {4, 21}) EXPECT_TRUE(send(800, command(c)).empty()) << c;
  // ...and at once when they fail.
  gHandlerResult = 28;
  for (uint64_t c : {4, 21, 2}) {
    auto replies = send(800, command(c));
    ASSERT_EQ(replies.size(), 1u) << c;
    EXPECT_EQ(replies[0].second.uint64ForKey("ReplyError"), 28u);
  }
  // A message that cannot be answered ends the connection unhandled.
  EXPECT_TRUE(send(800, command(0), false).empty());
  EXPECT_TRUE(cancelled_);
  EXPECT_FALSE(gSeen.called);
}

class FailingCommand : public QRVCommand {
 public:
  uint64_t command() const override { return 99; }
  bool fromQueue(QRVCommandQueue&, uint64_t* result) override {
    *result = 28;
    return false;
  }
};

TEST_F(RelayDispatcherTest, DeferredCommandFailureAndExceptionsBecomeTheResult) {
  table_[2].handler = [](const QRVPlist&, const std::shared_ptr<QRVReply>&, QRVClientConnection& c, uint64_t*) {
    c.commandQueue().insertCommand(std::make_shared<FailingCommand>());
  };
  table_[3].handler = [](const QRVPlist&, const std::shared_ptr<QRVReply>&, QRVClientConnection&, uint64_t*) {
    throw std::runtime_error("boom");
  };
  setClient(1000, entitlement(kEntitlementAllowed));
  EXPECT_EQ(resultOf(1000, 2), 28u);
  EXPECT_EQ(resultOf(1000, 3), 40u);
}

// A deferred command that fails without saying why.
class SilentlyFailingCommand : public QRVCommand {
 public:
  uint64_t command() const override { return 99; }
  bool fromQueue(QRVCommandQueue&, uint64_t*) override { return false; }
};

TEST_F(RelayDispatcherTest, FailuresWithoutAResultCodeAnswer40AndAreLogged) {
  QRVTemporaryDirectory logs;
  const std::string logPath = (std::filesystem::path(logs.path()) / "quorvad.log").string();
  ASSERT_TRUE(QRVLog::open("test", logPath, QRVLogLevel::kNotice, 2, 1 << 20));
  setClient(1100, entitlement(kEntitlementAllowed).set(kEntitlementUserManagedAssets, QRVPlist::boolean(true)));

  // A handler that stores 0, even one whose reply is normally sent later.
  gHandlerResult = 0;
  EXPECT_EQ(resultOf(1100, 5), 40u);
  EXPECT_EQ(resultOf(1100, 4), 40u);
  gHandlerResult = 1;

  // A handler whose error was never filled in, or is an errno value (1,
  // EPERM, would read as success): the handlers' path from error to code lets
  // neither reach the client.
  table_[6].handler = [](const QRVPlist&, const std::shared_ptr<QRVReply>&, QRVClientConnection&, uint64_t* result) {
    QRVError never;
    *result = never.resultCode();
  };
  table_[7].handler = [](const QRVPlist&, const std::shared_ptr<QRVReply>&, QRVClientConnection&, uint64_t* result) {
    *result = QRV_POSIX_ERROR_QUIET(EPERM, "open failed").resultCode();
  };
  EXPECT_EQ(resultOf(1100, 6), 40u);
  EXPECT_EQ(resultOf(1100, 7), 40u);

  // A deferred command that fails without a code used to leave the request
  // answering success.
  table_[2].handler = [](const QRVPlist&, const std::shared_ptr<QRVReply>&, QRVClientConnection& c, uint64_t*) {
    c.commandQueue().insertCommand(std::make_shared<SilentlyFailingCommand>());
  };
  EXPECT_EQ(resultOf(1100, 2), 40u);

  // Real codes pass through untouched, whatever their number.
  table_[8].handler = [](const QRVPlist&, const std::shared_ptr<QRVReply>&, QRVClientConnection&, uint64_t* result) {
    *result = QRV_ERROR_QUIET(QRVResultCode::kNoSuchContainer, "not there").resultCode();
  };
  EXPECT_EQ(resultOf(1100, 8), 21u);
  gHandlerResult = 1234;  // a code the list does not know is still the handler's to give
  EXPECT_EQ(resultOf(1100, 9), 1234u);
  gHandlerResult = 1;
  EXPECT_EQ(resultOf(1100, 9), 1u);

  QRVLog::close();
  std::stringstream log;
  log << std::ifstream(logPath).rdbuf();
  const std::string text = log.str();
  EXPECT_NE(text.find("command 5 failed without a result code; answering 40"), std::string::npos) << text;
  EXPECT_NE(text.find("command 2 failed without a result code; answering 40"), std::string::npos) << text;
  EXPECT_NE(text.find("a request failed without a result code (no error was set); answering 40"), std::string::npos)
      << text;
  EXPECT_NE(text.find("POSIXErrorDomain 1: open failed"), std::string::npos) << text;
}

TEST_F(RelayDispatcherTest, ACallerWithoutANameIsNullInTheLog) {
  const std::string logPath = env_.root.path() + "/names.log";
  ASSERT_TRUE(QRVLog::open("test", logPath, QRVLogLevel::kDebug, 2, 1 << 20));
  EXPECT_EQ(resultOf(600, 2), 55u);  // unknown to the trust store
  QRVLog::close();
  std::stringstream log;
  log << std::ifstream(logPath).rdbuf();
  EXPECT_NE(log.str().find("connection attempt from pid 600 ((null)) is not entitled"), std::string::npos) << log.str();
  EXPECT_NE(log.str().find("command=2, client=(null), error=55"), std::string::npos) << log.str();
}

TEST_F(RelayDispatcherTest, RegisteredEntitlementsAreRecordedOnlyForCallersWithPowers) {
  std::vector<std::string> recorded;
  processor_ = [&](const QRVPlist&, const std::string& id, QRVCommandQueue&) {
    recorded.push_back(id);
    return uint64_t{66};  // a failure does not refuse the request
  };
  setClient(1100, QRVPlist::dictionary());
  EXPECT_EQ(resultOf(1100, 0), 1u);
  EXPECT_EQ(resultOf(1100, 1), 55u);
  EXPECT_EQ(recorded, std::vector<std::string>{"com.example.client1100"});
}

}  // namespace

// The open commands reach callers the trust store does not know, who have no
// identity at all: the real handlers must refuse them rather than act for
// nobody (a null identity once took the daemon down here).
TEST(RelayDispatcherRealHandlersTest, AnUnidentifiedCallerIsRefusedByTheOpenCommands) {
  QRVTestServices env;
  QRVRelayDispatcher dispatcher(env.services, QRVDefaultCommandTable());
  QRVUUID uuid = QRVUUID::random();
  QRVPlist request = QRVPlist::dictionary()
                         .set("Identifier", QRVPlist::string("com.example.a"))
                         .set("ContainerClass", QRVPlist::uinteger(2))
                         .set("CreateIfNecessary", QRVPlist::boolean(true))
                         .set("UUID", QRVPlist::data(QRVPlist::Bytes(uuid.bytes().begin(), uuid.bytes().end())));
  for (uint64_t c : {0, 28}) {
    SCOPED_TRACE(c);
    auto connection = std::make_shared<QRVTestConnection>(600);
    dispatcher.QRVProcessRelayEvent(connection,
                                    connection->message(QRVPlist(request).set("Command", QRVPlist::uinteger(c))));
    ASSERT_EQ(connection->replies.size(), 1u);
    EXPECT_EQ(connection->replies[0].second.uint64ForKey("ReplyError"), 55u);
  }
  EXPECT_FALSE(std::filesystem::exists(env.root.path() + "/private/var/mobile/Containers/Data/Application"));
}

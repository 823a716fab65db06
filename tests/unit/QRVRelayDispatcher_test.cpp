#include "QRVRelayDispatcher.h"

#include <gtest/gtest.h>

#include <cstring>
#include <set>
#include <stdexcept>

#include "QRVClientConnection.h"
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
  gSeen.called = true;
  gSeen.entitled = c.isEntitled();
  gSeen.allowOtherIdLookup = c.allowOtherIdLookup();
  gSeen.unrestricted = c.isUnrestricted();
  gSeen.hasLookup = c.lookup().has_value();
  gSeen.wipeList = c.entitledWipeIdentifiers();
  if (gHandlerResult != 1) *result = gHandlerResult;
}

void throwingHandler(const QRVPlist&, const std::shared_ptr<QRVReply>&, QRVClientConnection&, uint64_t*) {
  throw std::runtime_error("boom");
}

// The daemon's table with a recording handler for every command but the
// retired one.
QRVCommandTable recordingTable() {
  QRVCommandTable t = QRVDefaultCommandTable();
  for (auto& e : t) e.handler = e.command == 27 ? nullptr : recordingHandler;
  return t;
}

class RelayDispatcherTest : public testing::Test {
 protected:
  void SetUp() override {
    gSeen = {};
    gHandlerResult = 1;
  }

  void setClient(pid_t pid, QRVPlist entitlements) {
    env_.trustStore->setClient(pid, {"com.example.client" + std::to_string(pid), std::move(entitlements)});
  }

  // Sends `command` from `pid` through a dispatcher over `table`; returns
  // the replies sent.
  std::vector<std::pair<uint64_t, QRVPlist>> send(const QRVCommandTable& table, pid_t pid, QRVPlist body) {
    gSeen = {};
    QRVRelayDispatcher dispatcher(env_.services, table);
    auto connection = std::make_shared<QRVTestConnection>(pid);
    dispatcher.QRVProcessRelayEvent(connection, connection->message(std::move(body), 7));
    cancelled_ = connection->cancelled;
    return connection->replies;
  }

  uint64_t resultOf(const QRVCommandTable& table, pid_t pid, uint64_t command) {
    auto replies = send(table, pid, QRVPlist::dictionary().set("Command", QRVPlist::uinteger(command)));
    if (replies.size() != 1) return 0;
    EXPECT_EQ(replies[0].first, 7u);
    return replies[0].second.uint64ForKey("ReplyError");
  }

  QRVTestServices env_;
  bool cancelled_ = false;
};

QRVPlist entitlement(const char* name, QRVPlist value = QRVPlist::boolean(true)) {
  return QRVPlist::dictionary().set(name, std::move(value));
}

TEST_F(RelayDispatcherTest, CallerWithoutEntitlementsRunsOnlyTheOpenCommandsRestricted) {
  const std::set<uint64_t> open = {0, 13, 15, 16, 17, 28};
  QRVCommandTable table = recordingTable();
  setClient(100, QRVPlist::dictionary());
  for (uint64_t c = 0; c < kQRVCommandCount; c++) {
    if (c == 27) continue;
    uint64_t result = resultOf(table, 100, c);
    if (open.count(c)) {
      EXPECT_EQ(result, 1u) << "command " << c;
      EXPECT_TRUE(gSeen.called);
      EXPECT_FALSE(gSeen.entitled || gSeen.unrestricted || gSeen.allowOtherIdLookup || gSeen.hasLookup) << c;
    } else {
      EXPECT_EQ(result, 55u) << "command " << c;
      EXPECT_FALSE(gSeen.called) << c;
    }
  }
}

TEST_F(RelayDispatcherTest, AllowedCallerIsUnrestrictedExceptForTestCommands) {
  QRVCommandTable table = recordingTable();
  setClient(101, entitlement(kEntitlementAllowed));
  for (uint64_t c = 0; c < kQRVCommandCount; c++) {
    if (c == 27) continue;
    uint64_t result = resultOf(table, 101, c);
    bool testCommand = strcmp(table[c].entitlement, kEntitlementTestability) == 0;
    if (testCommand) {
      EXPECT_EQ(result, 55u) << "command " << c;
    } else {
      // 4 and 21 answer from their own completion: no reply here.
      EXPECT_EQ(result, c == 4 || c == 21 ? 0u : 1u) << "command " << c;
      EXPECT_TRUE(gSeen.entitled && gSeen.unrestricted && gSeen.allowOtherIdLookup) << c;
      EXPECT_FALSE(gSeen.hasLookup);
    }
  }
  // With the testability right as well, test commands run, still restricted.
  setClient(102, entitlement(kEntitlementAllowed).set(kEntitlementTestability, QRVPlist::boolean(true)));
  for (uint64_t c : {25, 31}) {
    EXPECT_EQ(resultOf(table, 102, c), 1u);
    EXPECT_TRUE(gSeen.entitled);
    EXPECT_FALSE(gSeen.unrestricted);
  }
}

TEST_F(RelayDispatcherTest, EachCommandIsGrantedByItsOwnEntitlement) {
  QRVCommandTable table = recordingTable();
  pid_t pid = 200;
  for (uint64_t c = 0; c < kQRVCommandCount; c++) {
    if (c == 27 || c == 11) continue;  // 11 takes a list, below
    setClient(++pid, entitlement(table[c].entitlement));
    resultOf(table, pid, c);
    EXPECT_TRUE(gSeen.called && gSeen.entitled) << "command " << c;
    // Only "allowed" makes a caller unrestricted.
    EXPECT_EQ(gSeen.unrestricted, strcmp(table[c].entitlement, kEntitlementAllowed) == 0) << c;
  }
  // A number counts as a boolean; a string does not.
  setClient(300, entitlement(kEntitlementUserManagedAssets, QRVPlist::uinteger(1)));
  EXPECT_EQ(resultOf(table, 300, 29), 1u);
  setClient(301, entitlement(kEntitlementUserManagedAssets, QRVPlist::string("yes")));
  EXPECT_EQ(resultOf(table, 301, 29), 55u);
}

TEST_F(RelayDispatcherTest, WipeNeedsAListOrAnUnrestrictedCaller) {
  QRVCommandTable table = recordingTable();
  QRVPlist list = QRVPlist::array({QRVPlist::string("com.example.a")});
  setClient(400, entitlement(kEntitlementWipeContainer, list));
  EXPECT_EQ(resultOf(table, 400, 11), 1u);
  ASSERT_TRUE(gSeen.wipeList.has_value());
  EXPECT_EQ(*gSeen.wipeList, list.arrayValue());
  EXPECT_FALSE(gSeen.unrestricted);

  setClient(401, entitlement(kEntitlementWipeContainer));  // a boolean is not a list
  EXPECT_EQ(resultOf(table, 401, 11), 55u);

  setClient(402, entitlement(kEntitlementAllowed));
  EXPECT_EQ(resultOf(table, 402, 11), 1u);
  EXPECT_FALSE(gSeen.wipeList.has_value());
  EXPECT_TRUE(gSeen.unrestricted);
}

TEST_F(RelayDispatcherTest, LookupDictionaryOpensOnlyTheLookupCommands) {
  const std::set<uint64_t> lookup = {0, 1, 13, 14, 15, 16, 17, 23};
  QRVCommandTable table = recordingTable();
  setClient(500, entitlement(kEntitlementLookup, QRVPlist::dictionary().set("com.example.a", QRVPlist::boolean(true))));
  for (uint64_t c = 0; c < kQRVCommandCount; c++) {
    if (c == 27 || c == 28) continue;  // 28 is open to everyone, without lookup
    uint64_t result = resultOf(table, 500, c);
    if (lookup.count(c)) {
      EXPECT_EQ(result, 1u) << c;
      EXPECT_TRUE(gSeen.hasLookup) << c;
      EXPECT_FALSE(gSeen.entitled) << c;
    } else {
      EXPECT_EQ(result, 55u) << c;
    }
  }
  // Other-identifier look-up is its own right.
  setClient(501, entitlement(kEntitlementOtherIdLookup));
  EXPECT_EQ(resultOf(table, 501, 0), 1u);
  EXPECT_TRUE(gSeen.allowOtherIdLookup);
  EXPECT_FALSE(gSeen.entitled);
}

TEST_F(RelayDispatcherTest, UnidentifiedCallerHasNoPowers) {
  QRVCommandTable table = recordingTable();
  // pid 600 is unknown to the trust store: no signing identifier.
  EXPECT_EQ(resultOf(table, 600, 1), 55u);
  EXPECT_EQ(resultOf(table, 600, 0), 1u);
  EXPECT_TRUE(gSeen.called);
  EXPECT_FALSE(gSeen.entitled);
  // Unreadable entitlements read as none.
  env_.trustStore->setClient(601, {"com.example.noents", std::nullopt});
  EXPECT_EQ(resultOf(table, 601, 1), 55u);
}

TEST_F(RelayDispatcherTest, InvalidCommandsAnswer49) {
  QRVCommandTable table = recordingTable();
  setClient(700, entitlement(kEntitlementAllowed));
  EXPECT_EQ(resultOf(table, 700, 27), 49u);  // retired: no handler
  EXPECT_EQ(resultOf(table, 700, 32), 49u);
  EXPECT_EQ(resultOf(table, 700, UINT64_MAX), 49u);
  EXPECT_FALSE(gSeen.called);
  // An entry that does not describe its own index is refused.
  QRVCommandTable broken = table;
  broken[5].command = 6;
  EXPECT_EQ(resultOf(broken, 700, 5), 49u);
  EXPECT_FALSE(gSeen.called);
  // An absent or mistyped "Command" is command 0.
  auto replies = send(table, 700, QRVPlist::dictionary().set("Command", QRVPlist::string("5")));
  ASSERT_EQ(replies.size(), 1u);
  EXPECT_TRUE(gSeen.called);
  EXPECT_EQ(replies[0].second.uint64ForKey("ReplyError"), 1u);
}

TEST_F(RelayDispatcherTest, ExactlyOneReplyUnlessTheCommandAnswersLater) {
  QRVCommandTable table = recordingTable();
  setClient(800, entitlement(kEntitlementAllowed).set(kEntitlementUserManagedAssets, QRVPlist::boolean(true)));
  // 4 and 21 answer from their completion when they succeed...
  for (uint64_t c : {4, 21}) {
    auto replies = send(table, 800, QRVPlist::dictionary().set("Command", QRVPlist::uinteger(c)));
    EXPECT_TRUE(replies.empty()) << c;
  }
  // ...and at once when they fail.
  gHandlerResult = 28;
  for (uint64_t c : {4, 21, 2}) {
    auto replies = send(table, 800, QRVPlist::dictionary().set("Command", QRVPlist::uinteger(c)));
    ASSERT_EQ(replies.size(), 1u) << c;
    EXPECT_EQ(replies[0].second.uint64ForKey("ReplyError"), 28u);
  }
}

TEST_F(RelayDispatcherTest, MessageWithoutReplyContextCancelsTheConnection) {
  QRVRelayDispatcher dispatcher(env_.services, recordingTable());
  auto connection = std::make_shared<QRVTestConnection>(900);
  dispatcher.QRVProcessRelayEvent(connection, connection->message(QRVPlist::dictionary(), 1, false));
  EXPECT_TRUE(connection->cancelled);
  EXPECT_TRUE(connection->replies.empty());
  EXPECT_FALSE(gSeen.called);
}

class FailingCommand : public QRVCommand {
 public:
  explicit FailingCommand(uint64_t code) : code_(code) {}
  uint64_t command() const override { return 99; }
  bool fromQueue(QRVCommandQueue&, uint64_t* result) override {
    *result = code_;
    return false;
  }

 private:
  uint64_t code_;
};

void queueingHandler(const QRVPlist&, const std::shared_ptr<QRVReply>&, QRVClientConnection& c, uint64_t*) {
  c.commandQueue().insertCommand(std::make_shared<FailingCommand>(28));
}

TEST_F(RelayDispatcherTest, DeferredCommandFailureAndExceptionsBecomeTheResult) {
  QRVCommandTable table = recordingTable();
  table[2].handler = queueingHandler;
  table[3].handler = throwingHandler;
  setClient(1000, entitlement(kEntitlementAllowed));
  EXPECT_EQ(resultOf(table, 1000, 2), 28u);
  EXPECT_EQ(resultOf(table, 1000, 3), 40u);
}

TEST_F(RelayDispatcherTest, RegisteredEntitlementsAreRecordedOnlyForCallersWithPowers) {
  QRVCommandTable table = recordingTable();
  std::vector<std::string> recorded;
  setClient(1100, QRVPlist::dictionary());
  for (uint64_t c : {0, 1}) {
    QRVRelayDispatcher dispatcher(env_.services, table);
    dispatcher.setRegisteredEntitlementsProcessor([&](const QRVPlist&, const std::string& id, QRVCommandQueue&) {
      recorded.push_back(id);
      return uint64_t{66};  // a failure does not refuse the request
    });
    auto connection = std::make_shared<QRVTestConnection>(1100);
    dispatcher.QRVProcessRelayEvent(
        connection, connection->message(QRVPlist::dictionary().set("Command", QRVPlist::uinteger(c))));
    ASSERT_EQ(connection->replies.size(), 1u);
    EXPECT_EQ(connection->replies[0].second.uint64ForKey("ReplyError"), c == 0 ? 1u : 55u);
  }
  EXPECT_EQ(recorded, std::vector<std::string>{"com.example.client1100"});
}

}  // namespace

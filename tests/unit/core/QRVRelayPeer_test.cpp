#include "core/QRVRelayPeer.h"

#include <gtest/gtest.h>

#include "base/QRVResultCode.h"
#include "core/QRVCurrentPersona.h"
#include "support/QRVEventually.h"
#include "support/QRVTestConnection.h"
#include "support/QRVTestServices.h"

namespace {

class RelayPeerTest : public testing::Test {
 protected:
  RelayPeerTest() {
    env_.trustStore->setClient(10, {"com.example.tool", QRVPlist::dictionary()});
    connection_->state = QRVPeerProcessState{1, 100, false};
  }
  std::shared_ptr<const QRVClientIdentity> identity() { return peer_.clientIdentity(*connection_, *env_.services); }

  QRVTestServices env_;
  std::shared_ptr<QRVTestConnection> connection_ = std::make_shared<QRVTestConnection>(10, 600, 600);
  QRVRelayPeer peer_;
};

TEST_F(RelayPeerTest, AnIdentityIsKeptOnlyWhileEverythingItWasBuiltFromStaysTheSame) {
  auto first = identity();
  ASSERT_NE(first, nullptr);
  EXPECT_EQ(identity(), first);

  // The peer execs another program: it is identified anew.
  connection_->state->executableInode = 101;
  auto afterExec = identity();
  EXPECT_NE(afterExec, first);
  EXPECT_EQ(identity(), afterExec);

  // It confines itself.
  env_.sandbox->sandboxed[10] = true;
  connection_->state->confined = true;
  auto confined = identity();
  EXPECT_TRUE(confined->isSandboxed());
  EXPECT_EQ(identity(), confined);

  // The trust store changes under an unchanged peer.
  env_.trustStore->setClient(10, {"com.example.tool", QRVPlist::dictionary().set("x", QRVPlist::boolean(true))});
  auto retrusted = identity();
  EXPECT_TRUE(retrusted->boolValueOfEntitlement("x"));

  // A peer whose state cannot be read (it exited, or the platform cannot
  // tell) is identified from scratch every time.
  connection_->state.reset();
  auto unknown = identity();
  EXPECT_NE(unknown, retrusted);
  EXPECT_NE(identity(), unknown);

  // An unidentifiable peer is never kept either.
  connection_->state = QRVPeerProcessState{1, 102, true};
  env_.trustStore->setClient(10, {"", std::nullopt});
  EXPECT_EQ(identity(), nullptr);
  env_.trustStore->setClient(10, {"com.example.back", QRVPlist::dictionary()});
  EXPECT_EQ(identity()->bundleIdentifier(), "com.example.back");
}

TEST_F(RelayPeerTest, APersonaChangeGivesANewIdentity) {
  env_.personas->supported = true;
  env_.personas->list = {{1000, 501, 501, 0, "PERSONAL", "/private/var/mobile", {}, false, false},
                         {1001, 501, 501, 1, "WORK", "/private/var/work", {}, true, false}};
  env_.services->userIdentityCache->registerForPersonaListUpdates();
  QRVCurrentPersona::Scope scope(1001);
  auto work = identity();
  ASSERT_NE(work, nullptr);
  EXPECT_EQ(work->userIdentity()->identifier(), "WORK");
  EXPECT_EQ(identity(), work);
  env_.personas->change({{1000, 501, 501, 0, "PERSONAL", "/private/var/mobile", {}, false, false},
                         {1001, 501, 501, 1, "WORK-2", "/private/var/work", {}, true, false}});
  // The user identity cache learns of the change on its own queue.
  EXPECT_TRUE(QRVEventually([&] { return identity()->userIdentity()->identifier() == "WORK-2"; }));
}

TEST_F(RelayPeerTest, ARegistrationIsRepeatedOnlyWhenItFailedOrWhatItReadChanged) {
  int calls = 0;
  uint64_t answer = QRVResultCode::kSuccess;
  QRVRelayPeer::Registration registration = [&](const QRVPlist&, const std::string&, QRVCommandQueue&) {
    calls++;
    return answer;
  };
  QRVCommandQueue queue;
  auto caller = identity();
  EXPECT_EQ(peer_.registerEntitlements(caller, registration, 7, queue), QRVResultCode::kSuccess);
  EXPECT_EQ(peer_.registerEntitlements(caller, registration, 7, queue), QRVResultCode::kSuccess);
  EXPECT_EQ(calls, 1);
  peer_.registerEntitlements(caller, registration, 8, queue);
  EXPECT_EQ(calls, 2);
  // Another identity (an exec) registers its own entitlements.
  env_.trustStore->setClient(10, {"com.example.next", QRVPlist::dictionary()});
  peer_.registerEntitlements(identity(), registration, 8, queue);
  EXPECT_EQ(calls, 3);
  // A failure is reported every time and never remembered.
  answer = QRVResultCode::kDatabaseFailed;
  auto next = identity();
  EXPECT_EQ(peer_.registerEntitlements(next, registration, 9, queue), QRVResultCode::kDatabaseFailed);
  EXPECT_EQ(peer_.registerEntitlements(next, registration, 9, queue), QRVResultCode::kDatabaseFailed);
  EXPECT_EQ(calls, 5);
}

}  // namespace

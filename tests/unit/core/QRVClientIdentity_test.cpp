#include "core/QRVClientIdentity.h"

#include <gtest/gtest.h>

#include "core/QRVCurrentPersona.h"
#include "fs/QRVDictionaryAdditions.h"
#include "support/QRVTestConnection.h"
#include "support/QRVTestServices.h"

namespace {

class ClientIdentityTest : public testing::Test {
 protected:
  std::shared_ptr<const QRVClientIdentity> identityOf(const QRVTestConnection& c) {
    return QRVClientIdentity::clientIdentityWithRelayConnection(c, *env_.services);
  }
  QRVTestServices env_;
};

TEST_F(ClientIdentityTest, BuiltFromTheTrustStoreAndThePeerWithLenientEntitlements) {
  env_.trustStore->setClient(
      10, {"com.example.app", QRVPlist::dictionary().set("com.kelva.private.Quorva.allowed", QRVPlist::uinteger(1))});
  env_.sandbox->sandboxed[10] = true;
  QRVTestConnection peer(10, 600, 601);
  auto identity = identityOf(peer);
  ASSERT_NE(identity, nullptr);
  EXPECT_EQ(identity->bundleIdentifier(), "com.example.app");
  EXPECT_EQ(identity->posixUID(), 600u);
  EXPECT_EQ(identity->posixGID(), 601u);
  EXPECT_EQ(identity->posixPID(), 10);
  EXPECT_TRUE(identity->isSandboxed());
  EXPECT_EQ(identity->auditToken(), peer.auditToken());
  EXPECT_TRUE(identity->boolValueOfEntitlement("com.kelva.private.Quorva.allowed"));
  EXPECT_EQ(identity->userIdentity()->posixUID(), 600u);

  // Root callers act as the mobile user.
  EXPECT_EQ(identityOf(QRVTestConnection(10, 0, 0))->userIdentity()->posixUID(), 501u);

  // Unreadable entitlements are an empty dictionary; no signing identifier, no identity.
  env_.trustStore->setClient(11, {"com.example.noents", std::nullopt});
  identity = identityOf(QRVTestConnection(11));
  ASSERT_NE(identity, nullptr);
  EXPECT_TRUE(identity->entitlements().isDictionary());
  EXPECT_TRUE(identity->entitlements().dictionaryValue().empty());
  EXPECT_EQ(identityOf(QRVTestConnection(13)), nullptr);

  // Entitlements that are not booleans or numbers read as false.
  env_.trustStore->setClient(12, {"com.example.odd", QRVPlist::dictionary()
                                                         .set("a", QRVPlist::string("true"))
                                                         .set("b", QRVPlist::array({QRVPlist::boolean(true)}))});
  identity = identityOf(QRVTestConnection(12));
  EXPECT_FALSE(identity->boolValueOfEntitlement("a"));
  EXPECT_FALSE(identity->boolValueOfEntitlement("b"));
  EXPECT_FALSE(identity->boolValueOfEntitlement("missing"));
}

TEST_F(ClientIdentityTest, InstallerIdentityIsKeptWhileItsProcessLives) {
  const QRVPlist ents = QRVPlist::dictionary().set("com.kelva.private.Quorva.allowed", QRVPlist::boolean(true));
  env_.trustStore->setClient(20, {QRVClientIdentity::kInstallerIdentifier, ents});
  env_.trustStore->setClient(21, {QRVClientIdentity::kInstallerIdentifier, ents});
  QRVTestConnection installer(20);
  auto first = identityOf(installer);
  ASSERT_NE(first, nullptr);
  EXPECT_EQ(identityOf(installer), first);  // same audit token: the same object
  // A restarted installer has another token and gets a fresh identity,
  // which replaces the kept one.
  QRVTestConnection restarted(21);
  auto second = identityOf(restarted);
  EXPECT_NE(second, first);
  EXPECT_EQ(second->posixPID(), 21);
  EXPECT_EQ(identityOf(restarted), second);
  EXPECT_NE(identityOf(installer), first);
  // Other clients are never kept.
  env_.trustStore->setClient(22, {"com.example.app", ents});
  QRVTestConnection app(22);
  EXPECT_NE(identityOf(app), identityOf(app));
}

TEST_F(ClientIdentityTest, AnonymousPrivilegedIdentityIsAnUnsandboxedRootWithTheDefaultUser) {
  auto anonymous = QRVClientIdentity::anonymousPrivilegedClientIdentity(*env_.services->userIdentityCache);
  EXPECT_EQ(anonymous->posixUID(), 0u);
  EXPECT_TRUE(anonymous->auditToken().isZero() && !anonymous->isSandboxed());
  EXPECT_TRUE(anonymous->userIdentity()->isEqualToUserIdentity(*env_.services->userIdentityCache->defaultUserIdentity()));
}

TEST(PathAdditionsTest, DotDotComponents) {
  for (const char* bad : {"..", "../a", "a/..", "a/../b", "/..", "a//../b", "a/../"})
    EXPECT_TRUE(QRVContainsDotDotPathComponents(bad)) << bad;
  for (const char* fine : {"", ".", "a..b", "...", "..a", "a/...", "a/b..", "a/./b", "/a/b/"})
    EXPECT_FALSE(QRVContainsDotDotPathComponents(fine)) << fine;
}

TEST_F(ClientIdentityTest, PropertyListFiles) {
  QRVFileManager& fm = *env_.services->fileManager;
  std::string path = env_.root.path() + "/d.plist";
  QRVPlist d = QRVPlist::dictionary().set("k", QRVPlist::uinteger(7));
  QRVError error;
  ASSERT_TRUE(QRV_writeToURL(fm, d, path, &error));
  auto back = QRV_dictionaryWithContentsOfURL(fm, path, &error);
  ASSERT_TRUE(back);
  EXPECT_EQ(*back, d);
  ASSERT_TRUE(QRV_writeToURL(fm, QRVPlist::array(), path, &error));
  EXPECT_FALSE(QRV_dictionaryWithContentsOfURL(fm, path, &error));
  EXPECT_EQ(error.code(), 2048u);
  EXPECT_FALSE(QRV_dictionaryWithContentsOfURL(fm, path + ".missing", &error));
  EXPECT_EQ(error.code(), static_cast<uint64_t>(ENOENT));
  EXPECT_TRUE(error.isPOSIX());
}

}  // namespace

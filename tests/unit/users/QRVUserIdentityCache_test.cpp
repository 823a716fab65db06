#include "users/QRVUserIdentityCache.h"

#include <gtest/gtest.h>

#include "core/QRVCurrentPersona.h"
#include "platform/fake/QRVFakePlatform.h"
#include "support/QRVEventually.h"

namespace {

class UserIdentityCacheTest : public testing::Test {
 protected:
  UserIdentityCacheTest() {
    personas_->list = {
        {1000, 501, 501, 0, "PERSONAL", "/private/var/mobile", {}, false, false},
        {1001, 501, 501, 1, "WORK", "/private/var/work", {"com.example.mail"}, true, false},
        {1002, 501, 501, 2, "GUEST", "", {}, false, false},
    };
  }

  std::unique_ptr<QRVUserIdentityCache> makeCache() {
    QRVUserIdentityCache::Options o;
    o.mobileUID = 501;
    o.mobileGID = 501;
    o.homeDirectoryForUID = [](uid_t uid) { return "/root/home/" + std::to_string(uid); };
    o.pathUnderRoot = [](const std::string& p) { return "/root" + p; };
    o.retryInterval = std::chrono::milliseconds(1);
    return std::make_unique<QRVUserIdentityCache>(personas_, o);
  }

  std::shared_ptr<QRVFakePersonaService> personas_ = std::make_shared<QRVFakePersonaService>();
};

TEST_F(UserIdentityCacheTest, WithoutPersonasEveryoneIsPersonal) {
  auto cache = makeCache();
  auto u = cache->userIdentityForCurrentContextWithUID(600, 600);
  ASSERT_NE(u, nullptr);
  EXPECT_EQ(u->identifier(), "600");
  EXPECT_EQ(u->personaType(), QRVPersonaTypePersonal);
  // Below 501 the mobile account stands in.
  EXPECT_EQ(cache->userIdentityForCurrentContextWithUID(0, 0)->posixUID(), 501u);
  EXPECT_EQ(cache->userIdentityForCurrentContextWithUID(33, 33)->posixUID(), 501u);
  EXPECT_EQ(cache->defaultUserIdentity()->homeDirectoryURL(), "/root/home/501");
  EXPECT_EQ(personas_->fetches, 0);
}

TEST_F(UserIdentityCacheTest, CurrentPersonaDecidesTheIdentity) {
  personas_->supported = true;
  auto cache = makeCache();
  {
    QRVCurrentPersona::Scope scope(1000);
    auto u = cache->userIdentityForCurrentContextWithUID(501, 501);
    EXPECT_EQ(u->personaType(), QRVPersonaTypePersonal);
    EXPECT_EQ(u->homeDirectoryURL(), "/root/private/var/mobile");
  }
  {
    QRVCurrentPersona::Scope scope(1001);
    auto u = cache->userIdentityForCurrentContextWithUID(502, 502);
    EXPECT_TRUE(u->isEnterprise());
    EXPECT_EQ(u->identifier(), "WORK");
    EXPECT_EQ(u->posixUID(), 502u);
  }
  for (std::optional<uint32_t> p : {std::optional<uint32_t>(), std::optional<uint32_t>(1002),
                                    std::optional<uint32_t>(4242)}) {
    QRVCurrentPersona::Scope scope(p);
    auto u = cache->userIdentityForCurrentContextWithUID(501, 501);
    EXPECT_TRUE(u->isNoSpecificPersona());
    EXPECT_EQ(u->identifier(), "501");
  }
  EXPECT_EQ(personas_->fetches, 1);  // built once, kept

  EXPECT_EQ(cache->userIdentityWithPersonaID(1001)->identifier(), "WORK");
  EXPECT_EQ(cache->userIdentityWithPersonaID(7), nullptr);
  // A persona without a home gets its uid's home.
  EXPECT_EQ(cache->userIdentityForPersonaUniqueString("GUEST", 501, 501)->homeDirectoryURL(), "/root/home/501");
  auto mail = cache->userIdentitiesForBundleIdentifier("com.example.mail");
  ASSERT_EQ(mail.size(), 1u);
  EXPECT_TRUE(cache->isBundleIdentifier("com.example.mail", mail[0]));
  EXPECT_FALSE(cache->isBundleIdentifier("com.example.other", mail[0]));

  std::vector<std::string> seen;
  cache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [&](const QRVUserIdentityRef& u) { seen.push_back(u->identifier()); });
  EXPECT_EQ(seen, (std::vector<std::string>{"501", "WORK"}));
}

TEST_F(UserIdentityCacheTest, PersonaListChangeFlushesAndRebuilds) {
  personas_->supported = true;
  auto cache = makeCache();
  cache->registerForPersonaListUpdates();
  EXPECT_NE(cache->userIdentityForPersonaUniqueString("WORK", 501, 501), nullptr);
  auto list = personas_->list;
  list[1].uniqueString = "WORK2";
  personas_->change(list);
  // The flush runs asynchronously; the next question sees the new list.
  EXPECT_TRUE(QRVEventually([&] { return cache->userIdentityForPersonaUniqueString("WORK2", 501, 501) != nullptr; }));
  EXPECT_EQ(cache->userIdentityForPersonaUniqueString("WORK", 501, 501), nullptr);
}

TEST_F(UserIdentityCacheTest, EmptyListOrNoPersonalPersonaIsRetriedAndFinallyFatal) {
  personas_->supported = true;
  personas_->list.erase(personas_->list.begin());
  EXPECT_DEATH(makeCache()->unspecificUserIdentity(), "exhausting retries");
  personas_->list.clear();
  EXPECT_DEATH(makeCache()->userIdentityForPersonalPersona(),
               "Could not obtain persona attributes after exhausting retries.");
}

}  // namespace

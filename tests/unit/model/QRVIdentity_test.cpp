#include <gtest/gtest.h>

#include <unordered_set>

#include "model/QRVContainerIdentity.h"
#include "model/QRVUserIdentity.h"
#include "platform/fake/QRVFakePlatform.h"
#include "users/QRVUserIdentityCache.h"

namespace {

QRVUserIdentityRef personal(uid_t uid = 501, gid_t gid = 501, std::string persona = "") {
  return QRVUserIdentity::make(uid, gid, "/home/u" + std::to_string(uid), std::move(persona), QRVPersonaTypePersonal,
                               1000);
}

QRVUserIdentityRef enterprise(std::string persona, uid_t uid = 501) {
  return QRVUserIdentity::make(uid, uid, "/home/e", std::move(persona), QRVPersonaTypeEnterprise, 1001);
}

TEST(ContainerClassTest, ClassSetsFollowTheMasks) {
  for (QRVContainerClass c = 0; c <= 15; c++) {
    bool bundle = c == 1 || c == 3 || c == 5 || c == 8;
    bool system = c == 12 || c == 13;
    bool perUser = c == 2 || c == 4 || c == 6 || c == 7 || c == 9 || c == 10 || c == 11;
    EXPECT_EQ(QRVContainerClassIsBundle(c), bundle) << c;
    EXPECT_EQ(QRVContainerClassIsSystem(c), system) << c;
    EXPECT_EQ(QRVContainerClassIsPerUser(c), perUser) << c;
    EXPECT_EQ(QRVContainerClassIsValid(c), c >= 1 && c <= 13) << c;
    EXPECT_EQ(QRVUserIdentity::isUserIdentityRequiredForContainerClass(c), !bundle && !system) << c;
  }
  EXPECT_STREQ(QRVContainerClassRelativeDirectory(2), "Data/Application");
  EXPECT_STREQ(QRVContainerClassRelativeDirectory(13), "Shared/SystemGroup");
  EXPECT_STREQ(QRVContainerClassRelativeDirectory(14), "MAX");
  EXPECT_EQ(QRVContainerClassRelativeDirectory(15), nullptr);
  EXPECT_EQ(QRVContainerClassRelativeDirectory(UINT64_MAX), nullptr);
}

TEST(UserIdentityTest, IdentifierUIDFloorOwnersAndPersonaKey) {
  EXPECT_EQ(personal(500), nullptr);
  ASSERT_NE(personal(501), nullptr);
  EXPECT_EQ(enterprise("P")->identifier(), "P");
  EXPECT_EQ(personal(501, 501, "P")->identifier(), "501");
  // Enterprise without a string falls back to the uid.
  EXPECT_EQ(enterprise("")->identifier(), "501");

  // Equality rests on the identifier alone.
  EXPECT_TRUE(personal(501, 501)->isEqualToUserIdentity(*personal(501, 777, "X")));
  EXPECT_FALSE(personal(501)->isEqualToUserIdentity(*enterprise("P")));
  EXPECT_EQ(personal(501, 501)->hash(), personal(501, 777)->hash());

  auto u = personal(600, 700);
  EXPECT_EQ(u->posixUIDForContainerClass(2), 600u);
  EXPECT_EQ(u->posixGIDForContainerClass(2), 700u);
  EXPECT_EQ(u->posixUIDForContainerClass(1), CONTAINER_INSTALLATION_UID);
  EXPECT_EQ(u->posixGIDForContainerClass(1), CONTAINER_INSTALLATION_UID);  // a uid, on purpose
  EXPECT_EQ(u->posixUIDForContainerClass(13), CONTAINER_SYSTEM_UID);

  // No persona string: the key is left out rather than written empty.
  EXPECT_EQ(personal()->plist().get("personaUniqueString"), nullptr);
  EXPECT_EQ(enterprise("W")->plist().stringForKey("personaUniqueString"), "W");
}

class UserIdentityPlistTest : public testing::Test {
 protected:
  UserIdentityPlistTest() {
    personas_->supported = true;
    personas_->list = {{1000, 501, 501, 0, "PERSONAL", "/home/mobile", {}, false, false},
                       {1001, 501, 501, 1, "WORK", "/home/work", {}, false, false}};
    QRVUserIdentityCache::Options o;
    o.homeDirectoryForUID = [](uid_t) { return std::string("/home/mobile"); };
    cache_ = std::make_unique<QRVUserIdentityCache>(personas_, o);
  }
  std::shared_ptr<QRVFakePersonaService> personas_ = std::make_shared<QRVFakePersonaService>();
  std::unique_ptr<QRVUserIdentityCache> cache_;
};

TEST_F(UserIdentityPlistTest, RoundTripsAndVersionOne) {
  auto work = cache_->userIdentityForPersonaUniqueString("WORK", 501, 501);
  ASSERT_NE(work, nullptr);
  QRVPlist p = work->plist();
  EXPECT_EQ(p.stringForKey("version"), "2");
  EXPECT_EQ(p.stringForKey("personaUniqueString"), "WORK");
  QRVError error;
  auto back = QRVUserIdentity::userIdentityWithPlist(p, *cache_, &error);
  ASSERT_NE(back, nullptr);
  EXPECT_TRUE(back->isEqualToUserIdentity(*work));
  EXPECT_TRUE(back->isEnterprise());

  // A personal identity reads back personal, with its own ids.
  auto mine = cache_->userIdentityForPersonalPersonaWithUID(502, 20);
  QRVPlist mp = mine->plist();
  EXPECT_EQ(mp.uint64ForKey("type"), 0u);
  back = QRVUserIdentity::userIdentityWithPlist(mp, *cache_, &error);
  ASSERT_NE(back, nullptr);
  EXPECT_EQ(back->posixUID(), 502u);
  EXPECT_EQ(back->posixGID(), 20u);

  // Stored type 2 comes back as the personal persona of its uid.
  QRVPlist unspecific = mp;
  unspecific.set("type", QRVPlist::uinteger(2));
  back = QRVUserIdentity::userIdentityWithPlist(unspecific, *cache_, &error);
  ASSERT_NE(back, nullptr);
  EXPECT_EQ(back->personaType(), QRVPersonaTypePersonal);

  // Version 1 with a persona string, and with an unknown one.
  QRVPlist v1;
  v1.set("version", QRVPlist::string("1")).set("posixUID", QRVPlist::uinteger(501));
  v1.set("posixGID", QRVPlist::uinteger(501));
  for (auto [persona, identifier] : {std::pair{"WORK", "WORK"}, std::pair{"GONE", "501"}}) {
    back = QRVUserIdentity::userIdentityWithPlist(v1.set("personaIdentifier", QRVPlist::string(persona)), *cache_,
                                                  &error);
    ASSERT_NE(back, nullptr) << persona;
    EXPECT_EQ(back->identifier(), identifier);
  }
}

TEST_F(UserIdentityPlistTest, LaxAndStrictReadPaths) {
  QRVError error;
  // Not a dictionary, or a version that is not the string "1" or "2": an
  // empty identity and no error.
  for (QRVPlist bad : {QRVPlist::array(), QRVPlist::dictionary().set("version", QRVPlist::uinteger(2)),
                       QRVPlist::dictionary().set("version", QRVPlist::string("3"))}) {
    error = QRVError();
    auto u = QRVUserIdentity::userIdentityWithPlist(bad, *cache_, &error);
    ASSERT_NE(u, nullptr);
    EXPECT_EQ(u->posixUID(), 0u);
    EXPECT_TRUE(u->identifier().empty());
    EXPECT_EQ(error.code(), 0u);
  }
  QRVPlist good = cache_->userIdentityForPersonalPersona()->plist();
  for (const char* key : {"posixUID", "posixGID", "type"}) {
    QRVPlist broken = good;
    broken.set(key, QRVPlist::string("501"));
    EXPECT_EQ(QRVUserIdentity::userIdentityWithPlist(broken, *cache_, &error), nullptr) << key;
    EXPECT_EQ(error.code(), 75u) << key;
    broken.remove(key);
    EXPECT_EQ(QRVUserIdentity::userIdentityWithPlist(broken, *cache_, &error), nullptr) << key;
    EXPECT_EQ(error.code(), 75u);
  }
  QRVPlist badType = good;
  badType.set("type", QRVPlist::uinteger(3));
  EXPECT_EQ(QRVUserIdentity::userIdentityWithPlist(badType, *cache_, &error), nullptr);
  EXPECT_EQ(error.code(), 75u);
  // An enterprise persona the cache does not know: code 1.
  QRVPlist unknown = good;
  unknown.set("type", QRVPlist::uinteger(1)).set("personaUniqueString", QRVPlist::string("NOPE"));
  EXPECT_EQ(QRVUserIdentity::userIdentityWithPlist(unknown, *cache_, &error), nullptr);
  EXPECT_EQ(error.code(), 1u);
}

TEST(ContainerIdentityTest, ConstructionChecksInOrder) {
  QRVError error;
  EXPECT_EQ(QRVContainerIdentity::containerIdentityWithUserIdentity(nullptr, "", 14, &error), nullptr);
  EXPECT_EQ(error.code(), 11u);
  // A missing identifier is reported before the class is looked at.
  EXPECT_EQ(QRVContainerIdentity::containerIdentityWithUserIdentity(personal(), "", 14, &error), nullptr);
  EXPECT_EQ(error.code(), 18u);
  for (QRVContainerClass bad : {0ULL, 14ULL, 1000ULL}) {
    EXPECT_EQ(QRVContainerIdentity::containerIdentityWithUserIdentity(personal(), "a", bad, &error), nullptr);
    EXPECT_EQ(error.code(), 11u);
  }
  // The all-zero UUID is a UUID like any other.
  auto zero = QRVConcreteContainerIdentity::containerIdentityWithUUID(QRVUUID(), personal(), "a", 2, &error);
  ASSERT_NE(zero, nullptr) << error.description();
  EXPECT_TRUE(zero->uuid()->isNull());

  auto personas = std::make_shared<QRVFakePersonaService>();
  QRVUserIdentityCache cache(personas, {});
  EXPECT_EQ(QRVContainerIdentity::containerIdentityWithIdentifier("a", 2, cache, &error), nullptr);
  EXPECT_EQ(error.code(), 11u);
  auto bundle = QRVContainerIdentity::containerIdentityWithIdentifier("a", 1, cache, &error);
  ASSERT_NE(bundle, nullptr);
  EXPECT_TRUE(bundle->userIdentity()->isEqualToUserIdentity(*cache.defaultUserIdentity()));
}

TEST(ContainerIdentityTest, EqualityIsAsymmetricBetweenPlainAndConcrete) {
  QRVError error;
  QRVUUID uuid = QRVUUID::random();
  auto plain = QRVContainerIdentity::containerIdentityWithUserIdentity(personal(), "com.a", 2, &error);
  auto samePlain = QRVContainerIdentity::containerIdentityWithUserIdentity(personal(501, 9), "com.a", 2, &error);
  auto concrete = QRVConcreteContainerIdentity::containerIdentityWithUUID(uuid, personal(), "com.a", 2, &error);
  auto sameConcrete = QRVConcreteContainerIdentity::containerIdentityWithUUID(uuid, personal(), "com.a", 2, &error);
  auto otherUUID =
      QRVConcreteContainerIdentity::containerIdentityWithUUID(QRVUUID::random(), personal(), "com.a", 2, &error);
  auto otherClass = QRVContainerIdentity::containerIdentityWithUserIdentity(personal(), "com.a", 4, &error);
  auto otherUser = QRVContainerIdentity::containerIdentityWithUserIdentity(enterprise("W"), "com.a", 2, &error);

  EXPECT_TRUE(plain->isEqual(*samePlain));
  EXPECT_EQ(plain->hash(), samePlain->hash());
  EXPECT_FALSE(plain->isEqual(*otherClass));
  EXPECT_FALSE(plain->isEqual(*otherUser));
  EXPECT_TRUE(plain->isEqual(*concrete));   // plain looks at the base fields only
  EXPECT_FALSE(concrete->isEqual(*plain));  // concrete wants a concrete peer
  EXPECT_TRUE(concrete->isEqual(*sameConcrete));
  EXPECT_EQ(concrete->hash(), sameConcrete->hash());
  EXPECT_FALSE(concrete->isEqual(*otherUUID));

  std::unordered_set<QRVContainerIdentityRef, QRVContainerIdentityHash, QRVContainerIdentityEqual> set;
  set.insert(plain);
  EXPECT_EQ(set.count(samePlain), 1u);
  EXPECT_EQ(set.count(otherClass), 0u);
}

}  // namespace

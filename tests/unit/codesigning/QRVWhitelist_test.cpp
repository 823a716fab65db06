#include "codesigning/QRVWhitelist.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <limits>

#include "support/QRVContainerTest.h"

namespace {

QRVPlist strings(std::initializer_list<const char*> values) {
  QRVPlist array = QRVPlist::array();
  for (const char* v : values) array.append(QRVPlist::string(v));
  return array;
}

// A small table in the shapes of the built-in one.
QRVWhitelist smallTable() {
  QRVPlist system = QRVPlist::dictionary().set("com.example.sysd", QRVPlist::string("com.example.sysd"));
  QRVPlist groups = QRVPlist::dictionary().set("systemgroup.com.example.g", QRVPlist::string("gdir"));
  QRVPlist everybody = QRVPlist::dictionary().set("2", strings({"com.example.public"}));
  QRVPlist clients = QRVPlist::dictionary()
                         .set("com.example.root", QRVPlist())
                         .set("com.example.reader",
                              QRVPlist::dictionary().set("7", QRVPlist()).set("12", strings({"com.example.sysd"})));
  return QRVWhitelist(system, groups, everybody, clients);
}

TEST(WhitelistTest, NullMeansAnythingButNeverBeyondTheLastClass) {
  QRVWhitelist table = smallTable();
  // Null at the first level: every class up to 13, nothing from 14 on.
  for (uint64_t c = 0; c < 14; c++)
    EXPECT_TRUE(table.isLookupWhitelistedFromCodeSignIdentifier("com.example.root", c, "x"));
  for (uint64_t c : {uint64_t{14}, uint64_t{15}, std::numeric_limits<uint64_t>::max()})
    EXPECT_FALSE(table.isLookupWhitelistedFromCodeSignIdentifier("com.example.root", c, "x")) << c;

  // Null at the second level covers that class only; a set names identifiers.
  EXPECT_TRUE(table.isLookupWhitelistedFromCodeSignIdentifier("com.example.reader", 7, "group.any"));
  EXPECT_TRUE(table.isLookupWhitelistedFromCodeSignIdentifier("com.example.reader", 12, "com.example.sysd"));
  EXPECT_FALSE(table.isLookupWhitelistedFromCodeSignIdentifier("com.example.reader", 12, "com.example.other"));
  EXPECT_FALSE(table.isLookupWhitelistedFromCodeSignIdentifier("com.example.reader", 13, "com.example.sysd"));

  // The per-class sets serve any client, even one with no entry at all, but
  // only in their class.
  for (const char* client : {"com.example.nobody", "", "com.example.reader"}) {
    EXPECT_TRUE(table.isLookupWhitelistedFromCodeSignIdentifier(client, 2, "com.example.public")) << client;
    EXPECT_FALSE(table.isLookupWhitelistedFromCodeSignIdentifier(client, 4, "com.example.public")) << client;
  }
  EXPECT_FALSE(table.isLookupWhitelistedFromCodeSignIdentifier("com.example.nobody", 12, "com.example.sysd"));

  // Well-known names dispatch on the class: data classes know none.
  EXPECT_EQ(table.wellknownContainerForId("com.example.sysd", 12), "com.example.sysd");
  EXPECT_EQ(table.wellknownContainerForId("systemgroup.com.example.g", 13), "gdir");
  for (uint64_t c : {uint64_t{2}, uint64_t{7}, uint64_t{14}}) {
    EXPECT_EQ(table.wellknownContainerForId("com.example.sysd", c), std::nullopt) << c;
    EXPECT_FALSE(table.containerIdIsWellknown("com.example.sysd", c)) << c;
  }
  EXPECT_FALSE(table.containerIdIsWellknown("com.example.sysd", 13));
  EXPECT_FALSE(table.containerIdIsWellknown("systemgroup.com.example.g", 12));
  EXPECT_TRUE(table.containerIdIsWellknown("systemgroup.com.example.g", 13));
}

TEST(WhitelistTest, AHostileTableGrantsNothingItDoesNotSpellOut) {
  QRVPlist nested = QRVPlist::array();
  nested.append(strings({"com.example.inner"}));  // an array inside the array
  nested.append(QRVPlist::uinteger(7));
  nested.append(QRVPlist::dictionary().set("com.example.key", QRVPlist::string("v")));
  nested.append(QRVPlist::string("com.example.outer"));
  // A chain of dictionaries far deeper than anything the table uses.
  QRVPlist deep = strings({"com.example.bottom"});
  for (int i = 0; i < 300; i++) deep = QRVPlist::dictionary().set("2", deep);

  QRVPlist clients =
      QRVPlist::dictionary()
          .set("com.example.nested", QRVPlist::dictionary().set("2", nested))
          .set("com.example.string", QRVPlist::string("everything"))
          .set("com.example.array", strings({"2", "com.example.outer"}))
          .set("com.example.number", QRVPlist::dictionary().set("2", QRVPlist::uinteger(1)).set("02", QRVPlist()))
          .set("com.example.deep", deep);
  QRVPlist everybody = QRVPlist::dictionary()
                           .set("14", strings({"com.example.a"}))
                           .set("-1", strings({"com.example.a"}))
                           .set("02", strings({"com.example.a"}))
                           .set("x", strings({"com.example.a"}))
                           .set("4", QRVPlist::dictionary().set("com.example.a", QRVPlist()))
                           .set("3", nested);
  QRVPlist system = QRVPlist::dictionary()
                        .set("com.example.up", QRVPlist::string(".."))
                        .set("com.example.slash", QRVPlist::string("a/../../etc"))
                        .set("com.example.empty", QRVPlist::string(""))
                        .set("com.example.number", QRVPlist::uinteger(3))
                        .set("com.example.fine", QRVPlist::string("com.example.fine"));
  QRVWhitelist table(system, QRVPlist::string("not a dictionary"), everybody, clients);

  EXPECT_TRUE(table.isLookupWhitelistedFromCodeSignIdentifier("com.example.nested", 2, "com.example.outer"));
  for (const char* id : {"com.example.inner", "7", "com.example.key", "v"})
    EXPECT_FALSE(table.isLookupWhitelistedFromCodeSignIdentifier("com.example.nested", 2, id)) << id;
  // Values of the wrong shape grant nothing, at either level.
  for (const char* client : {"com.example.string", "com.example.array", "com.example.number", "com.example.deep"}) {
    for (uint64_t c : {uint64_t{2}, uint64_t{0}})
      for (const char* id : {"com.example.outer", "2", "1", "com.example.bottom", ""})
        EXPECT_FALSE(table.isLookupWhitelistedFromCodeSignIdentifier(client, c, id)) << client << " " << c << " " << id;
  }
  // Only well-formed class keys make per-class sets, and only of arrays.
  for (uint64_t c = 0; c < 16; c++) {
    EXPECT_FALSE(table.isLookupWhitelistedFromCodeSignIdentifier("com.example.nobody", c, "com.example.a")) << c;
    EXPECT_EQ(table.isLookupWhitelistedFromCodeSignIdentifier("com.example.nobody", c, "com.example.outer"), c == 3)
        << c;
  }
  // No directory name can lead out of the class directory.
  EXPECT_EQ(table.wellknownSystemContainers(), std::vector<std::string>{"com.example.fine"});
  EXPECT_FALSE(table.systemContainerIdIsWellknown("com.example.up"));
  EXPECT_EQ(table.wellknownSystemContainerForId("com.example.slash"), std::nullopt);
  EXPECT_TRUE(table.wellknownSystemGroupContainers().empty());
}

TEST(WhitelistTest, BuiltInTableNamesEachDirectoryAfterItsContainer) {
  const QRVWhitelist& external = QRVWhitelist::sharedWhitelist(false);
  const QRVWhitelist& internal = QRVWhitelist::sharedWhitelist(true);
  EXPECT_EQ(&external, &QRVWhitelist::sharedWhitelist(false));
  QRVWhitelist& table = const_cast<QRVWhitelist&>(internal);
  for (const std::string& id : internal.wellknownSystemContainers()) {
    EXPECT_EQ(table.wellknownSystemContainerForId(id), id);
    EXPECT_EQ(id.rfind("com.kelva.", 0), 0u) << id;
  }
  for (const std::string& id : internal.wellknownSystemGroupContainers()) {
    EXPECT_EQ(table.wellknownSystemGroupContainerForId(id), id);
    EXPECT_EQ(id.rfind("systemgroup.", 0), 0u) << id;
  }
  // An internal build knows exactly one more system group.
  std::vector<std::string> extra;
  for (const std::string& id : internal.wellknownSystemGroupContainers())
    if (!const_cast<QRVWhitelist&>(external).systemGroupContainerIdIsWellknown(id)) extra.push_back(id);
  EXPECT_EQ(extra.size(), 1u);
  EXPECT_EQ(external.wellknownSystemGroupContainers().size() + 1, internal.wellknownSystemGroupContainers().size());
  // The shared system group is well known and anyone may look it up.
  EXPECT_TRUE(table.systemGroupContainerIdIsWellknown(QRVWhitelist::kSharedSystemGroupIdentifier));
  EXPECT_TRUE(table.isLookupWhitelistedFromCodeSignIdentifier("", 13, QRVWhitelist::kSharedSystemGroupIdentifier));
}

TEST(WhitelistTest, TheDaemonsTableFollowsTheVariantAsFirstRead) {
  for (bool internal : {false, true}) {
    QRVTestServices env;
    // Set after the services are assembled, before anything asks.
    env.systemInfo->internal = internal;
    QRVWellKnownNames& names = *env.services->wellKnownNames;
    EXPECT_EQ(names.systemGroupContainerIdIsWellknown("systemgroup.com.kelva.quorva.internal"), internal);
    EXPECT_TRUE(names.systemGroupContainerIdIsWellknown(QRVWhitelist::kSharedSystemGroupIdentifier));
  }
}

class WhitelistContainerTest : public QRVContainerTest {};

TEST_F(WhitelistContainerTest, WellKnownContainersLiveUnderTheirNamesAndWhitelistedClientsFindOthers) {
  const std::string system = env_.root.path() + "/private/var/containers/Data/System/";
  const std::string groups = env_.root.path() + "/private/var/containers/Shared/SystemGroup/";
  // The daemon's services carry the built-in table.
  auto settings = create(identity("com.kelva.settingsd", QRVContainerClassSystemData));
  auto shared = create(identity(QRVWhitelist::kSharedSystemGroupIdentifier, QRVContainerClassSystemGroup));
  auto reporter = create(identity("com.kelva.crashreporterd", QRVContainerClassSystemData));
  auto app = create(identity("com.example.app"));
  ASSERT_TRUE(settings && shared && reporter && app);
  EXPECT_EQ(settings->url(), system + "com.kelva.settingsd");
  EXPECT_EQ(shared->url(), groups + QRVWhitelist::kSharedSystemGroupIdentifier);
  EXPECT_EQ(std::filesystem::path(reporter->url()).filename(), reporter->uuid().string());

  // A cache that starts from the disk takes the named directories for
  // containers, not for strays.
  freshCache();
  auto lookUp = [&](const std::string& caller, const std::string& id, QRVContainerClass c, QRVError* error) {
    *error = QRVError();
    return connectionFor(caller)->createOrLookupContainerWithContainerIdentity(identity(id, c),
                                                                               /*createIfNecessary=*/false,
                                                                               /*transient=*/false,
                                                                               /*useLocking=*/true, error);
  };
  QRVError error;
  auto found = lookup(identity("com.kelva.settingsd", QRVContainerClassSystemData), &error);
  ASSERT_NE(found, nullptr) << error.description();
  EXPECT_EQ(found->uuid(), settings->uuid());

  // Listed clients reach other identifiers' containers without entitlements.
  found = lookUp("com.kelva.diagnosticd", "com.kelva.crashreporterd", QRVContainerClassSystemData, &error);
  ASSERT_NE(found, nullptr) << error.description();
  EXPECT_EQ(found->uuid(), reporter->uuid());
  found = lookUp("com.kelva.settingsd", "com.example.app", QRVContainerClassAppData, &error);
  ASSERT_NE(found, nullptr) << error.description();
  EXPECT_EQ(found->url(), app->url());
  found = lookUp("com.example.other", QRVWhitelist::kSharedSystemGroupIdentifier, QRVContainerClassSystemGroup, &error);
  ASSERT_NE(found, nullptr) << error.description();
  EXPECT_EQ(found->url(), shared->url());

  // ... and nothing beyond what they are listed for.
  EXPECT_EQ(lookUp("com.kelva.diagnosticd", "com.kelva.settingsd", QRVContainerClassSystemData, &error), nullptr);
  EXPECT_EQ(error.code(), QRVResultCode::kNotEntitled);
  EXPECT_EQ(lookUp("com.example.other", "com.example.app", QRVContainerClassAppData, &error), nullptr);
  EXPECT_EQ(error.code(), QRVResultCode::kNotEntitled);
}

}  // namespace

#include "codesigning/QRVCodeSigningEntry.h"

#include <gtest/gtest.h>

#include <functional>

inline void PrintTo(const QRVCodeSigningEntry& e, std::ostream* os) { *os << e.description(); }

namespace {

QRVPlist info(const std::string& group) {
  QRVPlist groups = QRVPlist::array({QRVPlist::string(group)});
  QRVPlist entitlements;
  entitlements.set("com.kelva.security.application-groups", std::move(groups));
  QRVPlist d;
  d.set("com.kelva.Quorva.Entitlements", std::move(entitlements));
  return d;
}

QRVCodeSigningEntry fullEntry() {
  QRVCodeSigningEntry e(info("group.a"), 2);
  e.setChildBundleIdentifiers({{"com.example.app.widget"}});
  e.setInvalid(true);
  e.setPlaceholder(true);
  e.setAdvanceCopy(true);
  e.setRegisteredByCaller(true);
  return e;
}

TEST(QRVCodeSigningEntryTest, SerializedFormRoundTripsThroughABinaryPropertyList) {
  QRVCodeSigningEntry e = fullEntry();
  QRVPlist s = e.serialize();
  EXPECT_EQ(s.dictionaryValue().size(), 7u);
  EXPECT_EQ(*s.get("CodeSigningInfo"), info("group.a"));
  EXPECT_EQ(s.arrayForKey("ChildBundleIds").at(0).stringValue(), "com.example.app.widget");
  EXPECT_EQ(s.get("Invalid")->type(), QRVPlist::Type::Boolean);
  EXPECT_EQ(s.get("DataContainerClass")->type(), QRVPlist::Type::UInteger);

  QRVPlist::Bytes bytes = s.toBinary();
  auto parsed = QRVPlist::fromBinary(bytes.data(), bytes.size());
  ASSERT_TRUE(parsed);
  EXPECT_EQ(QRVCodeSigningEntry::initWithSerializedDictionary(*parsed), e);
}

TEST(QRVCodeSigningEntryTest, AbsentValuesAreLeftOutAndReadBackAsDefaults) {
  QRVPlist s = QRVCodeSigningEntry().serialize();
  EXPECT_EQ(s.get("CodeSigningInfo"), nullptr);
  EXPECT_EQ(s.get("ChildBundleIds"), nullptr);
  EXPECT_EQ(QRVCodeSigningEntry::initWithSerializedDictionary(s), QRVCodeSigningEntry());

  QRVPlist sparse;
  sparse.set("CodeSigningInfo", info("g"));
  sparse.set("ChildBundleIds", QRVPlist::array({QRVPlist::string("c"), QRVPlist::uinteger(7)}));
  sparse.set("Invalid", QRVPlist::string("yes"));  // wrong type reads as false
  QRVCodeSigningEntry e = QRVCodeSigningEntry::initWithSerializedDictionary(sparse);
  EXPECT_EQ(e.codeSigningInfo(), info("g"));
  EXPECT_EQ(e.childBundleIdentifiers(), std::vector<std::string>{"c"});
  EXPECT_FALSE(e.isInvalid() || e.isPlaceholder() || e.isAdvanceCopy() || e.isRegisteredByCaller());
  EXPECT_EQ(e.dataContainerClass(), 0u);

  // Only a dictionary is a code-signing dictionary.
  EXPECT_FALSE(QRVCodeSigningEntry(QRVPlist::string("not a dictionary")).hasCodeSigningInfo());
}

TEST(QRVCodeSigningEntryTest, EqualityCoversEveryPropertyAndEqualEntriesHashAlike) {
  const QRVCodeSigningEntry base = fullEntry();
  EXPECT_EQ(QRVCodeSigningEntry(base), base);
  EXPECT_EQ(fullEntry().hash(), base.hash());

  const std::vector<std::function<void(QRVCodeSigningEntry&)>> changes = {
      [](auto& e) { e.setCodeSigningInfo(info("group.b")); },
      [](auto& e) { e.setChildBundleIdentifiers(std::nullopt); },
      [](auto& e) { e.setChildBundleIdentifiers(std::vector<std::string>{}); },
      [](auto& e) { e.setInvalid(false); },
      [](auto& e) { e.setPlaceholder(false); },
      [](auto& e) { e.setAdvanceCopy(false); },
      [](auto& e) { e.setRegisteredByCaller(false); },
      [](auto& e) { e.setDataContainerClass(4); },
  };
  for (size_t i = 0; i < changes.size(); i++) {
    QRVCodeSigningEntry changed = base;
    changes[i](changed);
    EXPECT_NE(changed, base) << "change " << i;
  }
}

}  // namespace

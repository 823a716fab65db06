#include "base/QRVPlist.h"

#include <gtest/gtest.h>

#include <chrono>
#include <string>
#include <vector>

namespace {

using Bytes = QRVPlist::Bytes;
QRVPlist u(uint64_t v) { return QRVPlist::uinteger(v); }
QRVPlist s(std::string v) { return QRVPlist::string(std::move(v)); }

// Every type, nested and empty containers, edge integers, data with NULs.
// Dates are whole seconds, all that XML keeps.
QRVPlist everyType() {
  QRVPlist inner;
  inner.set("empty dict", QRVPlist::dictionary()).set("empty array", QRVPlist::array());
  inner.set("list", QRVPlist::array({u(1), s("two"), QRVPlist::array({QRVPlist::boolean(false)})}));
  QRVPlist v;
  v.set("true", QRVPlist::boolean(true)).set("false", QRVPlist::boolean(false)).set("zero", u(0));
  v.set("byte", u(255)).set("word", u(1ull << 32)).set("int64 max", u(INT64_MAX));
  v.set("above int64", u(uint64_t(INT64_MAX) + 1)).set("uint64 max", u(UINT64_MAX));
  v.set("real", QRVPlist::real(-2.5)).set("tenth", QRVPlist::real(0.1)).set("huge", QRVPlist::real(1e300));
  v.set("empty string", s("")).set("string", s("h\xC3\xA9llo <&>")).set("", s("empty key"));
  v.set("empty data", QRVPlist::data({})).set("data", QRVPlist::data({0, 0, 1, 0, 0xFF, 0}));
  v.set("date", QRVPlist::date({86400})).set("1970", QRVPlist::date({-978307200}));
  v.set("inner", inner).set("dicts", QRVPlist::array({inner, QRVPlist::dictionary(), inner}));
  return v;
}

std::optional<QRVPlist> parse(const Bytes& b) { return QRVPlist::fromBinary(b.data(), b.size()); }

TEST(QRVPlistTest, BinaryAndXMLRoundTrips) {
  for (const QRVPlist& v :
       {everyType(), u(UINT64_MAX), s(""), QRVPlist::data({0}), QRVPlist::array(), QRVPlist::real(0.5)}) {
    Bytes bin = v.toBinary();
    EXPECT_EQ(std::string(bin.begin(), bin.begin() + 8), "bplist00");
    EXPECT_EQ(parse(bin), v) << v.description();
    EXPECT_EQ(QRVPlist::fromXML(v.toXML()), v) << v.toXML();
  }
  // Binary dates keep the fraction and sign (before 2001) and range beyond
  // 32 bits of seconds (the "distant" sentinels).
  for (double t : {12.5, -0.25, -1.5, -978307199.75, 1.000001, 63113904000.0, -63114076800.0}) {
    auto back = parse(QRVPlist::array({QRVPlist::date({t})}).toBinary());
    ASSERT_TRUE(back && back->arrayValue().size() == 1) << t;
    EXPECT_EQ(back->arrayValue()[0].type(), QRVPlist::Type::Date);
    EXPECT_DOUBLE_EQ(back->arrayValue()[0].realValue(), t);
  }
  EXPECT_DOUBLE_EQ(QRVPlist::fromXML(QRVPlist::date({63113904000.0}).toXML()).value_or(u(0)).realValue(),
                   63113904000.0);
}

TEST(QRVPlistTest, TypedReadsAreLenient) {
  QRVPlist v;
  v.set("flag", QRVPlist::boolean(true)).set("n", u(5)).set("str", s("x"));
  v.set("bytes", QRVPlist::data({1, 2})).set("list", QRVPlist::array({u(1)}));
  v.set("dict", QRVPlist().set("a", u(1)));
  EXPECT_EQ(v.stringForKey("str"), "x");
  EXPECT_EQ(v.dataForKey("bytes"), (Bytes{1, 2}));
  // Absent keys and values of the wrong type read as zero, false or empty.
  for (std::string k : {"absent", "flag", "n", "str", "bytes", "list", "dict"}) {
    EXPECT_EQ(v.boolForKey(k), k == "flag") << k;
    EXPECT_EQ(v.uint64ForKey(k), k == "n" ? 5u : 0u) << k;
    EXPECT_EQ(v.stringForKey(k).empty(), k != "str") << k;
    EXPECT_EQ(v.dataForKey(k).empty(), k != "bytes") << k;
    EXPECT_EQ(v.arrayForKey(k).empty(), k != "list") << k;
    EXPECT_EQ(v.dictionaryForKey(k).empty(), k != "dict") << k;
  }
  EXPECT_EQ(v.get("absent"), nullptr);
  EXPECT_EQ(s("x").get("x"), nullptr);
  EXPECT_EQ(s("5").uint64Value(), 0u);
  EXPECT_EQ(u(5).realValue(), 0.0);
  // Truth: booleans and numbers only.
  for (const QRVPlist& yes : {QRVPlist::boolean(true), u(2), QRVPlist::real(0.5)})
    EXPECT_TRUE(yes.truthValue()) << yes.description();
  for (const QRVPlist& no : {QRVPlist::boolean(false), u(0), QRVPlist::real(0), s("true"), s("1"),
                             QRVPlist::array({u(1)}), QRVPlist().set("a", u(1)), QRVPlist()})
    EXPECT_FALSE(no.truthValue()) << no.description();
}

TEST(QRVPlistTest, MutationTurnsNoneIntoContainersAndReplacesOtherTypes) {
  QRVPlist d, removed, a, str = s("was a string");
  d.set("a", u(1)).set("b", u(2)).set("a", u(3)).set("c", u(4));
  d.remove("c");
  d.remove("never there");
  EXPECT_EQ(d, QRVPlist().set("b", u(2)).set("a", u(3)));
  removed.remove("x");
  EXPECT_EQ(removed, QRVPlist::dictionary());
  a.append(u(1));
  a.append(s("2"));
  EXPECT_EQ(a, QRVPlist::array({u(1), s("2")}));
  EXPECT_EQ(str.set("k", u(1)), QRVPlist().set("k", u(1)));
  d.append(u(9));
  EXPECT_EQ(d, QRVPlist::array({u(9)}));
}

void be(Bytes& b, uint64_t v, unsigned width) {
  for (unsigned i = width; i-- > 0;) b.push_back(static_cast<uint8_t>(v >> (8 * i)));
}
// An object marker with its count, followed by two-byte references.
Bytes obj(uint8_t kind, uint64_t count, const std::vector<uint64_t>& refs = {}) {
  Bytes o{static_cast<uint8_t>(kind << 4 | (count < 15 ? count : 0xF))};
  if (count >= 15) {
    o.push_back(0x13);
    be(o, count, 8);
  }
  for (uint64_t r : refs) be(o, r, 2);
  return o;
}
Bytes ascii(const std::string& str) {
  Bytes o = obj(0x5, str.size());
  o.insert(o.end(), str.begin(), str.end());
  return o;
}
// A binary property list of raw objects, object 0 at the root, with two-byte
// offsets and references: documents no writer would produce.
Bytes bplist(const std::vector<Bytes>& objects, uint64_t claimedObjects = 0) {
  Bytes b(8, 0), table;
  std::copy_n("bplist00", 8, b.begin());
  for (const Bytes& o : objects) {
    be(table, b.size(), 2);
    b.insert(b.end(), o.begin(), o.end());
  }
  uint64_t tableAt = b.size();
  b.insert(b.end(), table.begin(), table.end());
  be(b, 0x0202, 8);  // six unused bytes, offset size, reference size
  be(b, claimedObjects ? claimedObjects : objects.size(), 8);
  be(b, 0, 8);
  be(b, tableAt, 8);
  return b;
}

TEST(QRVPlistTest, FromBinaryRefusesHostileBytes) {
  ASSERT_EQ(parse(bplist({obj(0xD, 1, {1, 2}), ascii("k"), ascii("v")})), QRVPlist().set("k", s("v")));

  Bytes good = everyType().toBinary();
  for (size_t n = 0; n < good.size(); n++)
    ASSERT_FALSE(parse(Bytes(good.begin(), good.begin() + n))) << "truncated to " << n;
  // Trailer fields: offset size, reference size, object count, top object,
  // offset table position.
  uint64_t objects = 0;
  for (size_t i = 0; i < 8; i++) objects = objects << 8 | good[good.size() - 24 + i];
  struct Field {
    size_t at, width;
    uint64_t value;
  };
  const Field fields[] = {
      {6, 1, 0}, {6, 1, 9}, {7, 1, 0}, {8, 8, 0}, {8, 8, 1ull << 40}, {16, 8, objects}, {24, 8, good.size()},
      {24, 8, 0}};
  for (Field f : fields) {
    Bytes b = good;
    for (size_t i = 0; i < f.width; i++)
      b[b.size() - 32 + f.at + i] = static_cast<uint8_t>(f.value >> (8 * (f.width - 1 - i)));
    EXPECT_FALSE(parse(b)) << "trailer byte " << f.at << " = " << f.value;
  }
  Bytes pastEnd = bplist({obj(0xA, 1, {1}), ascii("x")});
  pastEnd[pastEnd.size() - 32 - 2] = 0x7F;  // object 1's offset
  EXPECT_FALSE(parse(pastEnd));
  EXPECT_FALSE(parse(bplist({obj(0xA, 1, {1}), ascii("x")}, 3)));  // a table too short
  EXPECT_FALSE(parse(bplist({obj(0xA, 1, {0})})));                 // contains itself
  EXPECT_FALSE(parse(bplist({obj(0xD, 1, {1, 2}), ascii("k"), obj(0xA, 1, {0})})));
  EXPECT_FALSE(parse(bplist({obj(0xA, 1, {5})})));  // no such object
  EXPECT_FALSE(parse(bplist({obj(0xA, 1000, {1}), ascii("k")})));
  EXPECT_FALSE(parse(bplist({obj(0xD, 0x8000000000000001ull, {1, 1}), ascii("k")})));
  // Keys holding NUL, ASCII and UTF-16 (libplist aborts reading them).
  EXPECT_FALSE(parse(bplist({obj(0xD, 1, {1, 2}), ascii(std::string("a\0b", 3)), ascii("v")})));
  EXPECT_FALSE(parse(bplist({obj(0xD, 1, {1, 2}), {0x62, 0, 'a', 0, 0}, ascii("v")})));

  // Any byte changed may or may not leave a property list, but never crashes.
  size_t parsed = 0;
  for (size_t i = 0; i < good.size(); i++) {
    for (uint8_t value : {uint8_t(0), uint8_t(0xFF), uint8_t(good[i] ^ 1)}) {
      Bytes b = good;
      b[i] = value;
      parsed += parse(b).has_value();
    }
  }
  EXPECT_GT(parsed, 0u);
}

TEST(QRVPlistTest, ReadersRefuseDeepNestingAndExpansionQuickly) {
  auto nested = [](int depth) {
    std::vector<Bytes> objects;
    for (int i = 0; i < depth; i++) objects.push_back(obj(0xA, 1, {uint64_t(i) + 1}));
    objects.push_back(ascii("leaf"));
    return bplist(objects);
  };
  EXPECT_TRUE(parse(nested(100)));
  EXPECT_FALSE(parse(nested(QRVPlist::kMaxDepth + 1)));
  auto nestedXML = [](int depth) {
    std::string x = "<plist>";
    for (int i = 0; i < depth; i++) x += i % 2 ? "<array>" : "<dict><key>k</key>";
    x += "<array/>";
    for (int i = depth; i-- > 0;) x += i % 2 ? "</array>" : "</dict>";
    return x + "</plist>";
  };
  EXPECT_TRUE(QRVPlist::fromXML(nestedXML(100)));
  EXPECT_FALSE(QRVPlist::fromXML(nestedXML(QRVPlist::kMaxDepth + 1)));
  EXPECT_FALSE(QRVPlist::fromXML(nestedXML(1000000)));

  // Each level references the next twice: 2^40 values from 41 objects.
  auto laughs = [](uint64_t levels) {
    std::vector<Bytes> objects;
    for (uint64_t i = 0; i < levels; i++) objects.push_back(obj(0xA, 2, {i + 1, i + 1}));
    objects.push_back(ascii("lol"));
    return bplist(objects);
  };
  auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(parse(laughs(40)));
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
  auto small = parse(laughs(3));  // a small shared DAG still expands
  ASSERT_TRUE(small);
  EXPECT_EQ(small->arrayValue()[1].arrayValue()[0].arrayValue()[1].stringValue(), "lol");
}

TEST(QRVPlistTest, FromBytesTellsBinaryFromXMLAndDescriptionIsCompact) {
  QRVPlist v = QRVPlist().set("k", s("v"));
  Bytes bin = v.toBinary();
  std::string xml = v.toXML();
  EXPECT_EQ(QRVPlist::fromBytes(bin.data(), bin.size()), v);
  EXPECT_EQ(QRVPlist::fromBytes(reinterpret_cast<const uint8_t*>(xml.data()), xml.size()), v);
  EXPECT_FALSE(QRVPlist::fromBytes(bin.data(), bin.size() - 1));  // never retried as XML
  EXPECT_FALSE(QRVPlist::fromBytes(reinterpret_cast<const uint8_t*>("junk"), 4));
  EXPECT_FALSE(QRVPlist::fromBytes(nullptr, 0));
  EXPECT_FALSE(QRVPlist::fromXML(""));

  QRVPlist d;
  d.set("Key", s("value")).set("List", QRVPlist::array({u(1), u(2)}));
  d.set("Data", QRVPlist::data({0x00, 0xAB})).set("Flag", QRVPlist::boolean(true));
  d.set("Empty", QRVPlist::dictionary()).set("None", QRVPlist::array({QRVPlist(), QRVPlist::array()}));
  d.set("Nested", QRVPlist().set("x", QRVPlist::real(2.5)));
  EXPECT_EQ(d.description(),
            "{Data = <00ab>; Empty = {}; Flag = 1; Key = \"value\"; List = (1, 2); "
            "Nested = {x = 2.5;}; None = ((null), ());}");
}

}  // namespace

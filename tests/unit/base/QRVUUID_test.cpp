#include "base/QRVUUID.h"

#include <gtest/gtest.h>

#include <cstring>
#include <set>
#include <string>
#include <unordered_set>

namespace {

TEST(QRVUUIDTest, RandomIsVersion4Variant1AndDistinct) {
  std::set<QRVUUID> ordered;
  std::unordered_set<QRVUUID> hashed;
  for (int i = 0; i < 1000; i++) {
    QRVUUID u = QRVUUID::random();
    EXPECT_EQ(u.bytes()[6] >> 4, 4) << u.string();
    EXPECT_EQ(u.bytes()[8] >> 6, 2) << u.string();
    ordered.insert(u);
    hashed.insert(u);
  }
  EXPECT_EQ(ordered.size(), 1000u);
  EXPECT_EQ(hashed.size(), 1000u);
  EXPECT_TRUE(QRVUUID().isNull());
}

TEST(QRVUUIDTest, TextIsUpperCase8_4_4_4_12AndParsesEitherCase) {
  QRVUUID u({0x01, 0x23, 0x45, 0x67, 0x89, 0xab, 0xcd, 0xef,  //
             0xfe, 0xdc, 0xba, 0x98, 0x76, 0x54, 0x32, 0x10});
  const std::string text = "01234567-89AB-CDEF-FEDC-BA9876543210";
  EXPECT_EQ(u.string(), text);
  EXPECT_EQ(QRVUUID::fromString(text), u);
  EXPECT_EQ(QRVUUID::fromString("01234567-89ab-cdef-fedc-ba9876543210"), u);

  for (const char* bad : {"", "01234567-89AB-CDEF-FEDC-BA987654321", "01234567-89AB-CDEF-FEDC-BA98765432100",
                          "0123456789ABCDEFFEDCBA9876543210", "01234567-89AB-CDEF-FEDC-BA987654321G",
                          "01234567-89AB-CDEF-FEDC-BA987654321g"})
    EXPECT_FALSE(QRVUUID::fromString(bad)) << bad;
  for (size_t i = 0; i < text.size(); i++) {  // every position: a dash, or a digit, out of place
    std::string moved = text;
    moved[i] = moved[i] == '-' ? '0' : '-';
    EXPECT_FALSE(QRVUUID::fromString(moved)) << moved;
  }
}

TEST(QRVUUIDTest, FromDataNeedsExactly16Bytes) {
  uint8_t raw[17];
  for (int i = 0; i < 17; i++) raw[i] = static_cast<uint8_t>(i * 7 + 1);
  auto u = QRVUUID::fromData(raw, 16);
  ASSERT_TRUE(u);
  EXPECT_EQ(std::memcmp(u->bytes().data(), raw, 16), 0);
  for (size_t n : {0, 15, 17}) EXPECT_FALSE(QRVUUID::fromData(raw, n)) << n;
  EXPECT_FALSE(QRVUUID::fromData(nullptr, 16));
}

}  // namespace

#include "base/QRVResultCode.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <set>
#include <string>

namespace {

TEST(QRVResultCodeTest, EveryCodeIsListedOnceWithADistinctNameAndText) {
  std::set<uint64_t> numbers;
  std::set<std::string_view> names, texts;
  for (const QRVResultCode::Entry& entry : QRVResultCode::all()) {
    SCOPED_TRACE(entry.name);
    EXPECT_TRUE(numbers.insert(entry.code).second);
    EXPECT_TRUE(entry.name.starts_with("k"));
    EXPECT_TRUE(names.insert(entry.name).second);
    EXPECT_FALSE(entry.text.empty());
    EXPECT_TRUE(texts.insert(entry.text).second) << "two codes print \"" << entry.text << "\"";
    EXPECT_FALSE(entry.meaning.empty());
    // The look-ups find each entry by its number.
    EXPECT_EQ(QRVResultCode::find(entry.code), &entry);
    EXPECT_EQ(QRVResultCode::text(entry.code), entry.text);
  }
  // The codes clients depend on, and those once missing from the client.
  for (uint64_t code : {1, 21, 38, 40, 48, 49, 55, 63, 64, 71, 76, 77}) EXPECT_TRUE(numbers.count(code)) << code;
  EXPECT_EQ(QRVResultCode::find(QRVResultCode::kNoSuchContainer)->name, "kNoSuchContainer");
}

TEST(QRVResultCodeTest, NumbersOutsideTheListAreNotFound) {
  // Below, between and above the listed numbers.
  for (uint64_t code :
       {uint64_t{0}, uint64_t{2}, uint64_t{13}, uint64_t{50}, uint64_t{78}, uint64_t{2048}, UINT64_MAX}) {
    EXPECT_EQ(QRVResultCode::find(code), nullptr) << code;
    EXPECT_TRUE(QRVResultCode::text(code).empty()) << code;
  }
}

}  // namespace

#include "client/QRVReplyFormat.h"

#include <gtest/gtest.h>

#include <set>
#include <string>

#include "base/QRVResultCode.h"

namespace {

std::string humanResult(uint64_t code) {
  return QRVReplyFormat::human(QRVPlist::dictionary().set("ReplyError", QRVPlist::uinteger(code)));
}

TEST(QRVReplyFormatTest, EveryListedCodePrintsItsOwnTextAndOthersAreUnknown) {
  std::set<std::string> lines;
  for (const QRVResultCode::Entry& entry : QRVResultCode::all()) {
    const std::string line = humanResult(entry.code);
    EXPECT_EQ(line, "ReplyError = " + std::to_string(entry.code) + " (" + std::string(entry.text) + ")\n");
    EXPECT_EQ(line.find("unknown"), std::string::npos) << line;
    EXPECT_TRUE(lines.insert(line).second) << line;
  }
  EXPECT_EQ(humanResult(21), "ReplyError = 21 (no such container)\n");
  for (uint64_t code : {uint64_t{0}, uint64_t{3}, uint64_t{50}, uint64_t{78}, UINT64_MAX})
    EXPECT_EQ(humanResult(code), "ReplyError = " + std::to_string(code) + " (unknown result code)\n");
}

}  // namespace

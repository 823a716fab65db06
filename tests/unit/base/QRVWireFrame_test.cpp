#include "base/QRVWireFrame.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace {

using Bytes = std::vector<uint8_t>;

TEST(QRVWireFrameTest, HeaderIsLittleEndianLengthFlagsId) {
  Bytes bytes(QRVWireFrame::kHeaderSize);
  QRVWireFrame::encodeHeader({0x11223344u, 0xA1B2C3D4u, 0x0102030405060708ull}, bytes.data());
  EXPECT_EQ(bytes, (Bytes{0x44, 0x33, 0x22, 0x11, 0xD4, 0xC3, 0xB2, 0xA1,  //
                          0x08, 0x07, 0x06, 0x05, 0x04, 0x03, 0x02, 0x01}));
  const Bytes wire{0xFF, 0xFF, 0xFF, 0xFF, 0x01, 0,    0,    0x80,  //
                   0xEF, 0xCD, 0xAB, 0x89, 0x67, 0x45, 0x23, 0xF1};
  QRVWireFrame::Header h = QRVWireFrame::decodeHeader(wire.data());
  EXPECT_EQ(h.length, 0xFFFFFFFFu);
  EXPECT_EQ(h.flags, 0x80000001u);
  EXPECT_EQ(h.messageId, 0xF123456789ABCDEFull);
}

TEST(QRVWireFrameTest, EncodeThenDecodeBodyRoundTrips) {
  QRVPlist body = QRVPlist().set("command", QRVPlist::uinteger(7)).set("path", QRVPlist::string("/x"));
  Bytes frame = QRVWireFrame::encode(body, QRVWireFrame::kFlagWantsReply, 42);
  QRVWireFrame::Header h = QRVWireFrame::decodeHeader(frame.data());
  EXPECT_EQ(h.length, frame.size() - QRVWireFrame::kHeaderSize);
  EXPECT_EQ(h.flags, QRVWireFrame::kFlagWantsReply);
  EXPECT_EQ(h.messageId, 42u);
  EXPECT_EQ(QRVWireFrame::decodeBody(frame.data() + QRVWireFrame::kHeaderSize, h.length), body);
}

TEST(QRVWireFrameTest, DecodeBodyRejectsNonDictionariesAndGarbage) {
  for (const QRVPlist& root :
       {QRVPlist::array({QRVPlist::uinteger(1)}), QRVPlist::string("x"), QRVPlist::uinteger(3)}) {
    Bytes b = root.toBinary();
    EXPECT_FALSE(QRVWireFrame::decodeBody(b.data(), b.size())) << root.description();
  }
  std::string xml = QRVPlist().set("a", QRVPlist::uinteger(1)).toXML();  // not the wire's form
  EXPECT_FALSE(QRVWireFrame::decodeBody(reinterpret_cast<const uint8_t*>(xml.data()), xml.size()));
  const std::string garbage = "bplist00 but not a property list, nor long enough to be one";
  EXPECT_FALSE(QRVWireFrame::decodeBody(reinterpret_cast<const uint8_t*>(garbage.data()), garbage.size()));
  Bytes good = QRVPlist().set("k", QRVPlist::string("v")).toBinary();
  EXPECT_FALSE(QRVWireFrame::decodeBody(good.data(), good.size() - 1));
}

}  // namespace

#include "base/QRVWireFrame.h"

#include <cstring>

namespace QRVWireFrame {

namespace {

uint64_t loadLE(const uint8_t* p, int n) {
  uint64_t v = 0;
  for (int i = n - 1; i >= 0; i--) v = (v << 8) | p[i];
  return v;
}

void storeLE(uint64_t v, uint8_t* p, int n) {
  for (int i = 0; i < n; i++, v >>= 8) p[i] = static_cast<uint8_t>(v);
}

}  // namespace

Header decodeHeader(const uint8_t* bytes) {
  Header h;
  h.length = static_cast<uint32_t>(loadLE(bytes, 4));
  h.flags = static_cast<uint32_t>(loadLE(bytes + 4, 4));
  h.messageId = loadLE(bytes + 8, 8);
  return h;
}

void encodeHeader(const Header& header, uint8_t* bytes) {
  storeLE(header.length, bytes, 4);
  storeLE(header.flags, bytes + 4, 4);
  storeLE(header.messageId, bytes + 8, 8);
}

std::vector<uint8_t> encode(const QRVPlist& body, uint32_t flags, uint64_t messageId) {
  QRVPlist::Bytes payload = body.toBinary();
  std::vector<uint8_t> frame(kHeaderSize + payload.size());
  encodeHeader({static_cast<uint32_t>(payload.size()), flags, messageId}, frame.data());
  if (!payload.empty()) memcpy(frame.data() + kHeaderSize, payload.data(), payload.size());
  return frame;
}

std::optional<QRVPlist> decodeBody(const uint8_t* bytes, size_t length) {
  auto value = QRVPlist::fromBinary(bytes, length);
  if (!value || !value->isDictionary()) return std::nullopt;
  return value;
}

}  // namespace QRVWireFrame

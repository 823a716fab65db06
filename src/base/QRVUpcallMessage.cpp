#include "base/QRVUpcallMessage.h"

#include <cstring>

namespace QRVUpcallMessage {

namespace {

// Integers as the peer's native data representation record describes them:
// little-endian, ASCII, IEEE floats.
constexpr uint8_t kNDRRecord[8] = {0, 0, 0, 0, 1, 0, 0, 0};

uint32_t readU32(const uint8_t* p) { return p[0] | (p[1] << 8) | (p[2] << 16) | (static_cast<uint32_t>(p[3]) << 24); }

void writeU32(uint8_t* p, uint32_t v) {
  for (int i = 0; i < 4; i++) p[i] = static_cast<uint8_t>(v >> (8 * i));
}

void writeHeader(uint8_t* p, const Header& h) {
  writeU32(p, h.bits);
  writeU32(p + 4, h.size);
  writeU32(p + 8, h.remotePort);
  writeU32(p + 12, h.localPort);
  writeU32(p + 16, h.voucher);
  writeU32(p + 20, h.id);
}

std::vector<uint8_t> encodeComplex(const Header& header, uint32_t size) {
  std::vector<uint8_t> m(kMessageSize, 0);
  writeHeader(m.data(), header);
  writeU32(m.data() + 24, 1);  // one descriptor; its address (28) stays 0
  writeU32(m.data() + 40, size);
  memcpy(m.data() + 44, kNDRRecord, sizeof kNDRRecord);
  writeU32(m.data() + 52, size);
  return m;
}

Header replyHeader(const Header& request, uint32_t bits, uint32_t size) {
  Header h;
  h.bits = (request.bits & kRemoteBitsMask) | bits;
  h.size = size;
  h.remotePort = request.remotePort;
  h.id = request.id + kReplyIDOffset;
  return h;
}

}  // namespace

std::optional<Header> decodeHeader(const uint8_t* bytes, size_t length) {
  if (length < kHeaderSize) return std::nullopt;
  Header h;
  h.bits = readU32(bytes);
  h.size = readU32(bytes + 4);
  h.remotePort = readU32(bytes + 8);
  h.localPort = readU32(bytes + 12);
  h.voucher = readU32(bytes + 16);
  h.id = readU32(bytes + 20);
  return h;
}

std::optional<Complex> decodeComplex(const uint8_t* bytes, size_t length) {
  if (length != kMessageSize) return std::nullopt;
  Complex c;
  c.header = *decodeHeader(bytes, length);
  c.descriptorCount = readU32(bytes + 24);
  c.descriptorAddress = readU32(bytes + 28) | (static_cast<uint64_t>(readU32(bytes + 32)) << 32);
  c.descriptorFlags = readU32(bytes + 36);
  c.descriptorSize = readU32(bytes + 40);
  c.count = readU32(bytes + 52);
  return c;
}

std::optional<int32_t> decodeReturnCode(const uint8_t* bytes, size_t length) {
  if (length != kErrorReplySize) return std::nullopt;
  return static_cast<int32_t>(readU32(bytes + 32));
}

std::vector<uint8_t> encodeRequest(uint32_t id, uint32_t size) {
  Header h;
  h.bits = kComplex;
  h.size = kMessageSize;
  h.id = id;
  return encodeComplex(h, size);
}

std::vector<uint8_t> encodeReply(const Header& request, uint32_t size) {
  return encodeComplex(replyHeader(request, kComplex, kMessageSize), size);
}

std::vector<uint8_t> encodeErrorReply(const Header& request, int32_t code) {
  std::vector<uint8_t> m(kErrorReplySize, 0);
  writeHeader(m.data(), replyHeader(request, 0, kErrorReplySize));
  memcpy(m.data() + 24, kNDRRecord, sizeof kNDRRecord);
  writeU32(m.data() + 32, static_cast<uint32_t>(code));
  return m;
}

}  // namespace QRVUpcallMessage

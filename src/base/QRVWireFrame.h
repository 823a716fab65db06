// Framing of the daemon's socket protocol, shared by the daemon and its
// clients.
//
// Every message is a 16-byte header followed by a body:
//   u32 body length (little-endian), u32 flags, u64 message id
// The body is a binary property list whose root is a dictionary. Flag bit 0
// marks a request that wants a reply (it carries a "reply context"); a reply
// carries the id of its request.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <vector>

#include "base/QRVPlist.h"

namespace QRVWireFrame {

constexpr size_t kHeaderSize = 16;
constexpr uint32_t kMaxBodySize = 16u << 20;
constexpr uint32_t kFlagWantsReply = 1u << 0;

struct Header {
  uint32_t length = 0;
  uint32_t flags = 0;
  uint64_t messageId = 0;
};

Header decodeHeader(const uint8_t* bytes);
void encodeHeader(const Header& header, uint8_t* bytes);

// Header and body of `body` as one buffer, ready to send.
std::vector<uint8_t> encode(const QRVPlist& body, uint32_t flags, uint64_t messageId);

// The body's dictionary, or nothing when the bytes are not a binary property
// list with a dictionary at its root.
std::optional<QRVPlist> decodeBody(const uint8_t* bytes, size_t length);

}  // namespace QRVWireFrame

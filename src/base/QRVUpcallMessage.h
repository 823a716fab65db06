// The messages of the kernel container-path service, shared by the daemon and
// the launchers that ask it.
//
// A request is one 56-byte message, all fields little-endian:
//   offset  0  u32 bits (kComplex marks a message with a memory descriptor)
//           4  u32 size (56)
//           8  u32 remote port, 12 u32 local port, 16 u32 voucher
//          20  u32 message id
//          24  u32 descriptor count (1)
//          28  u64 descriptor address (unused, 0)
//          36  u32 descriptor flags (not interpreted), 40 u32 descriptor size
//          44  8-byte NDR record
//          52  u32 count, equal to the descriptor size
// The descriptor's bytes (a packed buffer) travel beside the message as one
// sealed memory file. A successful reply has the same layout with the reply
// id (request id + 100) and describes the reply's packed buffer. An error
// reply is 36 bytes: the 24-byte header, the NDR record and an i32 return
// code.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <vector>

namespace QRVUpcallMessage {

constexpr uint32_t kComplex = 0x80000000u;
// The bits of a header that name the reply port's disposition; a reply
// carries them over from its request.
constexpr uint32_t kRemoteBitsMask = 0x1fu;

constexpr size_t kHeaderSize = 24;
constexpr size_t kMessageSize = 56;
constexpr size_t kErrorReplySize = 36;

constexpr uint32_t kGetProcessContainersID = 322514900;
// The second id of the service's range; no routine serves it.
constexpr uint32_t kUnservedID = 322514901;
constexpr uint32_t kReplyIDOffset = 100;

// Return codes of an error reply, beside the routine's own statuses.
constexpr int32_t kTypeError = -300;     // the message is not the expected request
constexpr int32_t kBadID = -303;         // no routine for this message id
constexpr int32_t kTrailerError = -309;  // no sender credentials
// Statuses of the routine that end it before any reply item is packed.
constexpr int32_t kStatusBadRequest = 4;    // an unknown item, or no user identity
constexpr int32_t kStatusUnreadable = 5;    // an item that cannot be unpacked
constexpr int32_t kStatusNoReplyBuffer = 9;  // the reply buffer cannot be made
// The caller is neither root nor entitled to the service (the daemon's
// result code for a caller that is not entitled).
constexpr int32_t kNotEntitled = 55;

// Value types of the request's packed-buffer items.
enum RequestItem : uint16_t {
  kRequestCodeSignatureID = 0,
  kRequestContainerID = 1,
  kRequestApplicationID = 2,
  kRequestUID = 3,
  kRequestAppGroupID = 4,  // repeatable
  kRequestContainerType = 5,
  kRequestSystemContainerID = 6,
  kRequestSystemGroupContainerID = 7,  // repeatable
  kRequestPersonaID = 8,
  kRequestLastItem = 8,
};
// The sandbox's container types (kRequestContainerType).
constexpr uint32_t kContainerTypeApplication = 0;
constexpr uint32_t kContainerTypePlugin = 1;
constexpr uint32_t kNoPersona = 0xFFFFFFFFu;

// Value types of the reply's items, packed in this order.
enum ReplyItem : uint16_t {
  kReplyStatus = 0,  // inline, always last: 1 when every lookup succeeded
  kReplyDataContainer = 1,
  kReplyTempDirectory = 2,
  kReplyAppGroupID = 3,  // key, followed by its path
  kReplyAppGroupPath = 4,
  kReplyHomeDirectory = 100,
  kReplySystemContainer = 101,
  kReplySystemGroupID = 102,  // key, followed by its path
  kReplySystemGroupPath = 103,
};

struct Header {
  uint32_t bits = 0;
  uint32_t size = 0;
  uint32_t remotePort = 0;
  uint32_t localPort = 0;
  uint32_t voucher = 0;
  uint32_t id = 0;
};

// A message carrying a memory descriptor: a request, or a successful reply.
struct Complex {
  Header header;
  uint32_t descriptorCount = 0;
  uint64_t descriptorAddress = 0;
  uint32_t descriptorFlags = 0;
  uint32_t descriptorSize = 0;
  uint32_t count = 0;
};

// Reads the header of any message; nothing when it is shorter than a header.
std::optional<Header> decodeHeader(const uint8_t* bytes, size_t length);
// Reads a message of exactly kMessageSize bytes; the fields are not checked.
std::optional<Complex> decodeComplex(const uint8_t* bytes, size_t length);
// The return code of an error reply; nothing unless `length` is
// kErrorReplySize.
std::optional<int32_t> decodeReturnCode(const uint8_t* bytes, size_t length);

// The request for `size` bytes of packed buffer, id `id`.
std::vector<uint8_t> encodeRequest(uint32_t id, uint32_t size);
// The replies to a request with header `request`: one describing `size`
// bytes, or an error reply with `code`.
std::vector<uint8_t> encodeReply(const Header& request, uint32_t size);
std::vector<uint8_t> encodeErrorReply(const Header& request, int32_t code);

}  // namespace QRVUpcallMessage

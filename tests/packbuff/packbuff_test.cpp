#include "packbuff/packbuff.h"

#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

// Lets the allocation-failure test see NULL instead of a sanitizer report.
extern "C" const char* __asan_default_options() { return "allocator_may_return_null=1"; }

namespace {

using Bytes = std::vector<uint8_t>;

// "0100 0500" -> {1, 0, 5, 0}; the blanks are for the reader.
Bytes Hex(std::string_view hex) {
  Bytes out;
  for (size_t i = 0; i < hex.size(); i += hex[i] == ' ' ? 1 : 2)
    if (hex[i] != ' ')
      out.push_back(static_cast<uint8_t>(std::stoi(std::string(hex.substr(i, 2)), nullptr, 16)));
  return out;
}

Bytes Contents(const sb_packbuff* pb) {
  auto* p = static_cast<const uint8_t*>(sb_packbuff_get_bytes(pb));
  return Bytes(p, p + sb_packbuff_get_size(pb));
}

std::string Printed(const sb_packbuff* pb) {
  testing::internal::CaptureStdout();
  sb_packbuff_print(pb);
  return testing::internal::GetCapturedStdout();
}

// "allocated/used/remaining", read from sb_packbuff_print() since the handle is opaque.
std::string Sizes(const sb_packbuff* pb) {
  std::string out = Printed(pb), sizes;
  for (const char* name : {"bytes_allocated: ", "bytes_used:      ", "bytes_remaining: "}) {
    size_t start = out.find(name) + strlen(name);
    sizes += (sizes.empty() ? "" : "/") + out.substr(start, out.find('\n', start) - start);
  }
  return sizes;
}

// Items to unpack, in a heap block of exactly their size so that ASan sees any overread.
struct Wire {
  explicit Wire(const Bytes& b) : bytes(b.begin(), b.end()) {
    pb = sb_packbuff_init_with_buffer(bytes.data(), bytes.size(), true, SB_PACKBUFF_DEALLOC_NONE);
  }
  ~Wire() { sb_packbuff_free(pb); }
  Bytes bytes;
  sb_packbuff* pb;
};

TEST(PackbuffTest, PacksAndUnpacksByteForByte) {
  sb_packbuff* pb = sb_packbuff_new(0);
  EXPECT_EQ(Contents(pb), Bytes(8, 0));
  ASSERT_EQ(sb_packbuff_pack_uint32(pb, 5, 7), 0);
  EXPECT_EQ(Contents(pb), Hex("0100 0500 07000000  0000 0000 00000000"));
  ASSERT_EQ(sb_packbuff_pack_string(pb, 0x102, "abc", 3), 0);
  ASSERT_EQ(sb_packbuff_pack_string(pb, 2, "", 0), 0);
  ASSERT_EQ(sb_packbuff_pack_bytes(pb, 3, "", 0), 0);
  ASSERT_EQ(sb_packbuff_pack_bytes(pb, 4, "01234567", 8), 0);
  ASSERT_EQ(sb_packbuff_pack_key_with_string_value(pb, 6, "group", 9, "/p"), 0);
  Bytes expected =
      Hex("0100 0500 07000000 "
          "0200 0201 04000000 61626300 00000000 "  // "abc": the length counts the NUL
          "0200 0200 01000000 00000000 00000000 "  // ""
          "0300 0300 00000000 "                    // no bytes, no padding
          "0300 0400 08000000 30313233 34353637 "
          "0200 0600 06000000 67726f75 70000000 0200 0900 03000000 2f700000 00000000 "
          "0000 0000 00000000");
  EXPECT_EQ(Contents(pb), expected);

  // Refused items leave the buffer as it was.
  EXPECT_EQ(sb_packbuff_pack_string(pb, 1, "abc", 2), EINVAL);
  EXPECT_EQ(sb_packbuff_pack_string(pb, 1, "abc", 0xFFFFFFFFu), EINVAL);
  EXPECT_EQ(sb_packbuff_pack_bytes(pb, 1, "x", 0x100000000u), EINVAL);
  EXPECT_EQ(sb_packbuff_pack_bytes(pb, 1, "x", 0xFFFFFFF1u), ERANGE);  // padded length overflows
  EXPECT_EQ(sb_packbuff_pack_key_with_string_value(pb, 1, nullptr, 2, "v"), EINVAL);
  EXPECT_EQ(Contents(pb), expected);
  sb_packbuff_free(pb);

  Wire in(expected);
  uint16_t type = 0;
  size_t length = 99;
  int error = -1;
  EXPECT_EQ(sb_packbuff_unpack_uint32(in.pb, &error), 7u);
  EXPECT_EQ(error, 0);
  ASSERT_TRUE(sb_packbuff_get_item_value_type(in.pb, &type));
  EXPECT_EQ(type, 0x102);
  EXPECT_STREQ(sb_packbuff_unpack_string(in.pb, &length, nullptr), "abc");
  EXPECT_EQ(length, 3u);
  EXPECT_STREQ(sb_packbuff_unpack_string(in.pb, &length, nullptr), "");
  EXPECT_EQ(length, 0u);
  EXPECT_NE(sb_packbuff_unpack_bytes(in.pb, &length, nullptr), nullptr);
  EXPECT_EQ(length, 0u);
  EXPECT_EQ(sb_packbuff_skip_item(in.pb), 0);
  const char* key = nullptr;
  const char* value = nullptr;
  ASSERT_EQ(sb_packbuff_unpack_key_with_string_value(in.pb, &key, &type, &value, &length), 0);
  EXPECT_STREQ(key, "group");
  EXPECT_EQ(type, 9);  // the value item's type, as peers expect
  EXPECT_STREQ(value, "/p");
  EXPECT_EQ(length, 2u);
  EXPECT_FALSE(sb_packbuff_get_item_value_type(in.pb, &type));
}

// Unpacks one item as `kind` says and returns the error.
int Unpack(char kind, sb_packbuff* pb) {
  int error = -1;
  switch (kind) {
    case 'u': sb_packbuff_unpack_uint32(pb, &error); return error;
    case 's': sb_packbuff_unpack_string(pb, nullptr, &error); return error;
    case 'b': sb_packbuff_unpack_bytes(pb, nullptr, &error); return error;
    case 'p':
      return sb_packbuff_unpack_key_with_string_value(pb, nullptr, nullptr, nullptr, nullptr);
    default: return sb_packbuff_skip_item(pb);
  }
}

TEST(PackbuffTest, RejectsBadInputWithoutMoving) {
  struct {
    char unpack;  // see Unpack()
    const char* hex;
    int error;
  } cases[] = {
      {'s', "0200 0100 64000000 61000000 00000000", ERANGE},  // length runs past the end
      {'k', "0200 0100 64000000 61000000 00000000", ERANGE},
      {'u', "0100 0100 05000000", ERANGE},  // no room left for the end item
      {'u', "0100 0100", ERANGE},           // truncated header
      {'k', "0100 0100", ERANGE},
      {'k', "0400 0600 00000000 00000000", EINVAL},  // unknown item type
      {'b', "0400 0600 00000000 00000000", EINVAL},
      {'k', "0000 0000 00000000", EINVAL},
      {'s', "0200 0100 04000000 61626364 00000000 00000000", EINVAL},  // no NUL
      {'s', "0200 0100 00000000 00000000", EINVAL},                    // zero length
      {'u', "0200 0100 02000000 6b000000 00000000", EINVAL},
      {'p', "0200 0100 02000000 6b000000 0100 0200 09000000 00000000", EINVAL},
  };
  for (const auto& c : cases) {
    Wire in(Hex(c.hex));
    std::string before = Printed(in.pb);  // shows the cursor
    EXPECT_EQ(Unpack(c.unpack, in.pb), c.error) << c.unpack << " " << c.hex;
    EXPECT_EQ(Printed(in.pb), before) << c.hex;
  }
  uint16_t type;
  EXPECT_FALSE(sb_packbuff_get_item_value_type(Wire(Hex("0100 0100")).pb, &type));
}

TEST(PackbuffTest, GrowsByBlockSizePlusItem) {
  sb_packbuff* pb = sb_packbuff_new(3);  // too small: the default block
  EXPECT_EQ(Sizes(pb), "256/8/248");
  sb_packbuff_free(pb);

  pb = sb_packbuff_new(8);
  EXPECT_EQ(Sizes(pb), "8/8/0");
  std::string s(100, 's');
  ASSERT_EQ(sb_packbuff_pack_string(pb, 1, s.c_str(), s.size()), 0);
  EXPECT_EQ(Sizes(pb), "128/120/8");  // 8 + 8 + the 112-byte item
  ASSERT_EQ(sb_packbuff_pack_uint32(pb, 2, 42), 0);
  EXPECT_EQ(Sizes(pb), "128/128/0");
  ASSERT_EQ(sb_packbuff_pack_uint32(pb, 3, 43), 0);  // one block is enough
  EXPECT_EQ(Sizes(pb), "136/136/0");
  sb_packbuff_free(pb);

  EXPECT_EQ(sb_packbuff_new(SIZE_MAX / 2), nullptr);
}

TEST(PackbuffTest, WrappedBufferNeverGrows) {
  uint8_t storage[32];
  EXPECT_EQ(sb_packbuff_init_with_buffer(storage, 7, false, SB_PACKBUFF_DEALLOC_NONE), nullptr);
  EXPECT_EQ(sb_packbuff_init_with_buffer(storage, 32, false, 3), nullptr);
  sb_packbuff* pb = sb_packbuff_init_with_buffer(storage, 32, false, SB_PACKBUFF_DEALLOC_NONE);
  // The key does not fit; the value would, but must not be packed alone.
  EXPECT_EQ(sb_packbuff_pack_key_with_string_value(pb, 1, "a key too long to fit", 2, "v"),
            ENOTSUP);
  EXPECT_EQ(Contents(pb), Bytes(8, 0));
  ASSERT_EQ(sb_packbuff_pack_uint32(pb, 1, 1), 0);
  EXPECT_EQ(sb_packbuff_pack_string(pb, 1, "0123456789", 10), ENOTSUP);  // 24 bytes, 16 left
  ASSERT_EQ(sb_packbuff_pack_uint32(pb, 1, 2), 0);
  ASSERT_EQ(sb_packbuff_pack_uint32(pb, 1, 3), 0);
  Bytes full = Contents(pb);
  EXPECT_EQ(full.size(), 32u);
  EXPECT_EQ(sb_packbuff_pack_uint32(pb, 1, 4), ENOTSUP);
  EXPECT_EQ(Contents(pb), full);
  sb_packbuff_free(pb);  // ASan would report a free() of the stack array

  // A heap buffer handed over is freed with the handle, but still never grows.
  pb = sb_packbuff_init_with_buffer(malloc(16), 16, false, SB_PACKBUFF_DEALLOC_FREE);
  ASSERT_EQ(sb_packbuff_pack_uint32(pb, 1, 1), 0);
  EXPECT_EQ(sb_packbuff_pack_uint32(pb, 1, 2), ENOTSUP);
  sb_packbuff_free(pb);
}

TEST(PackbuffTest, UnmapsWholeMappedRegion) {
  long page = sysconf(_SC_PAGESIZE);
  void* map = mmap(nullptr, 2 * page, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  ASSERT_NE(map, MAP_FAILED);
  sb_packbuff_free(sb_packbuff_init_with_buffer(map, page + 8, false, SB_PACKBUFF_DEALLOC_MAPPED));
  unsigned char resident;
  EXPECT_EQ(mincore(static_cast<char*>(map) + page, page, &resident), -1);  // partial page too
  EXPECT_EQ(errno, ENOMEM);
}

TEST(PackbuffTest, PrintWalkStaysInsideHostileItems) {
  // Unknown items are stepped over; a length past the used bytes ends the walk.
  Wire bad(Hex("0900 0100 00000000 0200 0100 c8000000 78000000 00000000"));
  auto at = [&](int offset) { return static_cast<const void*>(bad.bytes.data() + offset); };
  std::string out = Printed(bad.pb);
  EXPECT_NE(out.find("  dealloc_type:    None\n"), std::string::npos);
  char want[512];
  snprintf(want, sizeof(want),
           "*  0:%p -- value type 1 --*Unknown item type* 9\n"
           "   1:%p -- value type 1 --string (%p, 0 pad bytes, size: 200): \n"
           ">> item pointer exceeds end of buffer. <<\n",
           at(0), at(8), at(16));
  EXPECT_EQ(out.substr(out.find("\n\n") + 2), want);
}

TEST(PackbuffDeathTest, BytesWithoutDataAbort) {
  sb_packbuff* pb = sb_packbuff_new(0);
  EXPECT_DEATH(sb_packbuff_pack_bytes(pb, 1, nullptr, 0), "additional_bytes != NULL");
  sb_packbuff_free(pb);
}

}  // namespace

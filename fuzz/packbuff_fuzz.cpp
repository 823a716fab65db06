// Unpacks arbitrary bytes with every unpack call, packs what was read into a
// fresh buffer, and checks that unpacking that buffer gives the same items.

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "packbuff/packbuff.h"

namespace {

struct Item {
  int kind;  // SB_PACKBUFF_ITEM_*
  uint16_t value_type;
  uint32_t value;
  std::string payload;
  bool operator==(const Item&) const = default;
};

void Check(bool ok, const char* what) {
  if (!ok) {
    fprintf(stderr, "packbuff_fuzz: %s\n", what);
    abort();
  }
}

// Reads items with the plain calls until none can be read.
std::vector<Item> ReadAll(sb_packbuff* pb) {
  std::vector<Item> items;
  uint16_t type;
  while (sb_packbuff_get_item_value_type(pb, &type)) {
    int error = 0;
    size_t length = 0;
    uint32_t value = sb_packbuff_unpack_uint32(pb, &error);
    if (error == 0) {
      items.push_back({SB_PACKBUFF_ITEM_INLINE, type, value, {}});
      continue;
    }
    if (const char* s = sb_packbuff_unpack_string(pb, &length, &error)) {
      Check(s[length] == '\0', "string without NUL");
      items.push_back({SB_PACKBUFF_ITEM_STRING, type, 0, std::string(s, length)});
      continue;
    }
    if (auto* b = static_cast<const char*>(sb_packbuff_unpack_bytes(pb, &length, &error))) {
      items.push_back({SB_PACKBUFF_ITEM_BYTES, type, 0, std::string(b, length)});
      continue;
    }
    break;
  }
  return items;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  // sb_packbuff_print() is exercised for its bounds, not its output.
  if (freopen("/dev/null", "w", stdout) == nullptr) abort();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  // The first byte is options: bits 0-5 the growth block size, so that tiny
  // and default blocks both get exercised; bit 6 a misuse of set_size. The
  // rest is the wire buffer, in a block of its exact size so that any read
  // past its end hits a redzone.
  if (size < 2) return 0;
  size_t block_size = data[0] & 0x3F;
  std::vector<uint8_t> wire(data + 1, data + size);
  sb_packbuff* in =
      sb_packbuff_init_with_buffer(wire.data(), wire.size(), true, SB_PACKBUFF_DEALLOC_NONE);
  sb_packbuff_print(in);

  // Walk with every call, preferring key/value pairs, and pack what was read.
  sb_packbuff* out = sb_packbuff_new(block_size);
  std::vector<Item> packed;
  uint16_t type;
  while (sb_packbuff_get_item_value_type(in, &type)) {
    const char* key;
    const char* value;
    size_t length = 0;
    int error = 0;
    uint16_t pair_type = 0;
    if (sb_packbuff_unpack_key_with_string_value(in, &key, &pair_type, &value, &length) == 0) {
      Check(value[length] == '\0', "value without NUL");
      Check(sb_packbuff_pack_key_with_string_value(out, pair_type, key, pair_type, value) == 0,
            "pack pair");
      packed.push_back({SB_PACKBUFF_ITEM_STRING, pair_type, 0, key});
      packed.push_back({SB_PACKBUFF_ITEM_STRING, pair_type, 0, value});
      continue;
    }
    uint32_t v = sb_packbuff_unpack_uint32(in, &error);
    if (error == 0) {
      Check(sb_packbuff_pack_uint32(out, type, v) == 0, "pack uint32");
      packed.push_back({SB_PACKBUFF_ITEM_INLINE, type, v, {}});
      continue;
    }
    if (const char* s = sb_packbuff_unpack_string(in, &length, &error)) {
      Check(sb_packbuff_pack_string(out, type, s, length) == 0, "pack string");
      packed.push_back({SB_PACKBUFF_ITEM_STRING, type, 0, std::string(s, length)});
      continue;
    }
    if (auto* b = static_cast<const char*>(sb_packbuff_unpack_bytes(in, &length, &error))) {
      Check(sb_packbuff_pack_bytes(out, type, b, length) == 0, "pack bytes");
      packed.push_back({SB_PACKBUFF_ITEM_BYTES, type, 0, std::string(b, length)});
      continue;
    }
    Check(error == EINVAL || error == ERANGE, "unpack error");
    // Unknown item types cannot be skipped; anything else readable can.
    if (sb_packbuff_skip_item(in) != 0) break;
  }
  sb_packbuff_print(out);

  // What was packed must come back unchanged, and fill the buffer exactly.
  std::vector<uint8_t> copy(
      static_cast<uint8_t*>(sb_packbuff_get_bytes(out)),
      static_cast<uint8_t*>(sb_packbuff_get_bytes(out)) + sb_packbuff_get_size(out));
  sb_packbuff* back =
      sb_packbuff_init_with_buffer(copy.data(), copy.size(), true, SB_PACKBUFF_DEALLOC_NONE);
  Check(ReadAll(back) == packed, "round trip");
  Check(sb_packbuff_skip_item(back) == EINVAL, "end item");
  Check(copy.size() % 8 == 0 &&
            std::all_of(copy.end() - 8, copy.end(), [](uint8_t b) { return b == 0; }),
        "trailing end item");
  sb_packbuff_free(back);

  // sb_packbuff_set_size() is unchecked; packing and printing afterwards must
  // still stay inside the buffer.
  if (data[0] & 0x40) {
    sb_packbuff_set_size(out, wire.size() % (copy.size() + 64));
    sb_packbuff_pack_uint32(out, 1, 2);
    sb_packbuff_pack_string(out, 1, "abc", 3);
    sb_packbuff_print(out);
  }
  sb_packbuff_free(out);
  sb_packbuff_free(in);
  return 0;
}

// strnlen() and munmap() are POSIX, not ISO C.
#define _POSIX_C_SOURCE 200809L

#include "packbuff/packbuff.h"

#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <syslog.h>

#define BYTE_ALIGNMENT 8
#define HEADER_SIZE 8

// Unlike assert(), stays in release builds: these guard memory safety.
#define PACKBUFF_CHECK(cond)                                                                  \
  do {                                                                                        \
    if (!(cond)) {                                                                            \
      fprintf(stderr, "packbuff: assertion failed: %s (%s:%d)\n", #cond, __FILE__, __LINE__); \
      abort();                                                                                \
    }                                                                                         \
  } while (0)

struct sb_packbuff {
  uint32_t dealloc_type;
  size_t block_size;  // 0 for a wrapped buffer
  size_t bytes_allocated;
  size_t bytes_remaining;
  size_t bytes_used;  // includes the trailing end item
  uint8_t* item_buffer;
  // While packing, the trailing end item; while unpacking, the next item.
  uint8_t* item;
};

// An item header as read from the buffer, with the distance to the next item.
struct item {
  uint16_t type;
  uint16_t value_type;
  uint32_t word;  // inline value or payload length
  const uint8_t* payload;
  uint64_t step;
};

static uint64_t round_up(uint64_t n) {
  return (n + BYTE_ALIGNMENT - 1) & ~(uint64_t)(BYTE_ALIGNMENT - 1);
}

// Offsets rather than pointer comparisons: a cursor below the buffer wraps to
// a huge offset and fails the same single test as one past its end.
static size_t cursor_offset(const sb_packbuff* pb) {
  return (uintptr_t)pb->item - (uintptr_t)pb->item_buffer;
}

static void write_header(uint8_t* p, uint16_t type, uint16_t value_type, uint32_t word) {
  memcpy(p, &type, 2);
  memcpy(p + 2, &value_type, 2);
  memcpy(p + 4, &word, 4);
}

// Decodes the header at `p`; the caller has checked that its 8 bytes exist.
// Items of unknown type are taken to be 8 bytes long.
static void read_item(const uint8_t* p, struct item* it) {
  memcpy(&it->type, p, 2);
  memcpy(&it->value_type, p + 2, 2);
  memcpy(&it->word, p + 4, 4);
  it->payload = p + HEADER_SIZE;
  it->step = HEADER_SIZE;
  if (it->type == SB_PACKBUFF_ITEM_STRING || it->type == SB_PACKBUFF_ITEM_BYTES)
    it->step += round_up(it->word);
}

static int sb_packbuff_grow(sb_packbuff* pb, size_t bytes_needed) {
  if (pb->block_size == 0 || pb->dealloc_type != SB_PACKBUFF_DEALLOC_FREE) return ENOTSUP;
  size_t need = round_up(bytes_needed);
  size_t allocated = pb->bytes_allocated + pb->block_size;
  if (allocated < pb->block_size) return ENOMEM;
  if (need > allocated - pb->bytes_used) {
    allocated += need;
    if (allocated < need) return ENOMEM;
  }
  uint8_t* buffer = realloc(pb->item_buffer, allocated);
  if (buffer == NULL) {
    free(pb->item_buffer);
    pb->item_buffer = pb->item = NULL;
    pb->bytes_allocated = pb->bytes_used = pb->bytes_remaining = 0;
    return ENOMEM;
  }
  pb->item_buffer = buffer;
  pb->bytes_allocated = allocated;
  pb->bytes_remaining = allocated - pb->bytes_used;
  pb->item = pb->bytes_used != 0 ? buffer + pb->bytes_used - HEADER_SIZE : buffer;
  return 0;
}

sb_packbuff* sb_packbuff_new_with_tag(size_t block_size, uint32_t tag) {
  (void)tag;  // malloc() takes no allocation labels
  sb_packbuff* pb = calloc(1, sizeof(*pb));
  if (pb == NULL) return NULL;
  pb->block_size = block_size < BYTE_ALIGNMENT ? SB_PACKBUFF_DEFAULT_BLOCK_SIZE : block_size;
  pb->dealloc_type = SB_PACKBUFF_DEALLOC_FREE;
  if (sb_packbuff_grow(pb, HEADER_SIZE) != 0) {
    free(pb);
    return NULL;
  }
  pb->bytes_used = HEADER_SIZE;
  pb->bytes_remaining -= HEADER_SIZE;
  write_header(pb->item_buffer, SB_PACKBUFF_ITEM_END, 0, 0);
  return pb;
}

sb_packbuff* sb_packbuff_new(size_t block_size) { return sb_packbuff_new_with_tag(block_size, 0); }

sb_packbuff* sb_packbuff_init_with_buffer_and_tag(void* buffer, size_t size, bool has_contents,
                                                  uint32_t dealloc_type, uint32_t tag) {
  (void)tag;
  if (buffer == NULL || dealloc_type > SB_PACKBUFF_DEALLOC_MAPPED ||
      (!has_contents && size < HEADER_SIZE))
    return NULL;
  sb_packbuff* pb = calloc(1, sizeof(*pb));
  if (pb == NULL) return NULL;
  pb->dealloc_type = dealloc_type;
  pb->bytes_allocated = size;
  pb->item_buffer = pb->item = buffer;
  if (has_contents) {
    pb->bytes_used = size;
  } else {
    write_header(pb->item_buffer, SB_PACKBUFF_ITEM_END, 0, 0);
    pb->bytes_used = HEADER_SIZE;
  }
  pb->bytes_remaining = size - pb->bytes_used;
  return pb;
}

sb_packbuff* sb_packbuff_init_with_buffer(void* buffer, size_t size, bool has_contents,
                                          uint32_t dealloc_type) {
  return sb_packbuff_init_with_buffer_and_tag(buffer, size, has_contents, dealloc_type, 0);
}

void sb_packbuff_free(sb_packbuff* pb) {
  if (pb == NULL) return;
  if (pb->dealloc_type == SB_PACKBUFF_DEALLOC_FREE) {
    free(pb->item_buffer);
  } else if (pb->dealloc_type == SB_PACKBUFF_DEALLOC_MAPPED) {
    // munmap() covers whole pages, so this releases the transport's entire
    // mapping even when the items end short of its last page.
    if (munmap(pb->item_buffer, pb->bytes_allocated) != 0)
      syslog(LOG_ERR, "failed: vm_deallocate(%p, %zu)", (void*)pb->item_buffer,
             pb->bytes_allocated);
  }
  free(pb);
}

void* sb_packbuff_get_bytes(const sb_packbuff* pb) { return pb->item_buffer; }

size_t sb_packbuff_get_size(const sb_packbuff* pb) { return pb->bytes_used; }

void sb_packbuff_set_size(sb_packbuff* pb, size_t size) {
  pb->bytes_used = size;
  pb->bytes_remaining = pb->bytes_allocated - size;
}

// Writes one item over the end item at the cursor and a new end item after it.
static int sb_packbuff_pack_item(sb_packbuff* pb, uint16_t type, uint16_t value_type,
                                 uint32_t value, const void* additional_bytes,
                                 size_t extra_bytes_needed) {
  if (type == SB_PACKBUFF_ITEM_INLINE)
    PACKBUFF_CHECK(extra_bytes_needed == 0);
  else
    PACKBUFF_CHECK(additional_bytes != NULL);
  // The length field is a u32 and must still describe a padded payload.
  if (extra_bytes_needed > UINT32_MAX) return ERANGE;
  uint64_t padded = round_up(extra_bytes_needed);
  if (padded >= 0xFFFFFFF8u) return ERANGE;
  size_t item_size = padded + HEADER_SIZE;

  // A handle whose growth failed has no buffer; growing again would build
  // items on a buffer without its end item.
  if (pb->item_buffer == NULL) return ENOMEM;
  if (pb->bytes_remaining < item_size) {
    int error = sb_packbuff_grow(pb, item_size);
    if (error != 0) return error;
  }
  // The trailing end item is reused, so the item and a new end item need
  // item_size bytes past the old bytes_used. sb_packbuff_set_size() can break
  // that bookkeeping; never write outside the allocation because of it.
  size_t offset = cursor_offset(pb);
  if (offset > pb->bytes_allocated || pb->bytes_allocated - offset < item_size + HEADER_SIZE)
    return ERANGE;

  uint8_t* p = pb->item;
  if (type == SB_PACKBUFF_ITEM_INLINE) {
    write_header(p, type, value_type, value);
  } else {
    write_header(p, type, value_type, (uint32_t)extra_bytes_needed);
    memcpy(p + HEADER_SIZE, additional_bytes, extra_bytes_needed);
    memset(p + HEADER_SIZE + extra_bytes_needed, 0, padded - extra_bytes_needed);
  }
  pb->bytes_remaining -= item_size;
  pb->bytes_used += item_size;
  pb->item += item_size;
  write_header(pb->item, SB_PACKBUFF_ITEM_END, 0, 0);
  return 0;
}

int sb_packbuff_pack_uint32(sb_packbuff* pb, uint16_t value_type, uint32_t value) {
  return sb_packbuff_pack_item(pb, SB_PACKBUFF_ITEM_INLINE, value_type, value, NULL, 0);
}

int sb_packbuff_pack_string(sb_packbuff* pb, uint16_t value_type, const char* string,
                            size_t length) {
  if (string == NULL || length > 0xFFFFFFFEu || string[length] != '\0') return EINVAL;
  return sb_packbuff_pack_item(pb, SB_PACKBUFF_ITEM_STRING, value_type, 0, string, length + 1);
}

int sb_packbuff_pack_bytes(sb_packbuff* pb, uint16_t value_type, const void* data, size_t length) {
  if (length > UINT32_MAX) return EINVAL;
  return sb_packbuff_pack_item(pb, SB_PACKBUFF_ITEM_BYTES, value_type, 0, data, length);
}

int sb_packbuff_pack_key_with_string_value(sb_packbuff* pb, uint16_t key_value_type,
                                           const char* key, uint16_t value_value_type,
                                           const char* value) {
  if (key == NULL || value == NULL) return EINVAL;
  int error = sb_packbuff_pack_string(pb, key_value_type, key, strlen(key));
  if (error != 0) return error;
  return sb_packbuff_pack_string(pb, value_value_type, value, strlen(value));
}

// Reads the header at the cursor; ERANGE unless all 8 bytes lie inside the
// allocation, so a truncated header is never read.
static int read_item_at_cursor(const sb_packbuff* pb, struct item* it) {
  size_t offset = cursor_offset(pb);
  if (offset >= pb->bytes_allocated || pb->bytes_allocated - offset < HEADER_SIZE) return ERANGE;
  read_item(pb->item, it);
  return 0;
}

// Checks that the item at the cursor has the expected type and that the item
// after it starts inside the allocation. Moves nothing, so callers can reject
// the contents too before moving the cursor.
static int sb_packbuff_unpack_item(const sb_packbuff* pb, uint16_t type, struct item* it) {
  int error = read_item_at_cursor(pb, it);
  if (error != 0) return error;
  if (it->type != type) return EINVAL;
  // Half-open: an item ending exactly at the end of the allocation is refused,
  // because an end item must still follow it.
  if (it->step >= pb->bytes_allocated - cursor_offset(pb)) return ERANGE;
  uint64_t bytes_to_advance = it->step;
  PACKBUFF_CHECK((bytes_to_advance % BYTE_ALIGNMENT) == 0);
  return 0;
}

bool sb_packbuff_get_item_value_type(const sb_packbuff* pb, uint16_t* value_type) {
  struct item it;
  if (read_item_at_cursor(pb, &it) != 0 || it.type == SB_PACKBUFF_ITEM_END) return false;
  *value_type = it.value_type;
  return true;
}

static void set_error(int* error, int value) {
  if (error != NULL) *error = value;
}

uint32_t sb_packbuff_unpack_uint32(sb_packbuff* pb, int* error) {
  struct item it;
  int e = sb_packbuff_unpack_item(pb, SB_PACKBUFF_ITEM_INLINE, &it);
  set_error(error, e);
  if (e != 0) return 0;
  pb->item += it.step;
  return it.word;
}

const char* sb_packbuff_unpack_string(sb_packbuff* pb, size_t* length, int* error) {
  struct item it;
  int e = sb_packbuff_unpack_item(pb, SB_PACKBUFF_ITEM_STRING, &it);
  if (e == 0 && (it.word == 0 || it.payload[it.word - 1] != '\0')) e = EINVAL;
  set_error(error, e);
  if (e != 0) return NULL;
  pb->item += it.step;
  if (length != NULL) *length = it.word - 1;
  return (const char*)it.payload;
}

const void* sb_packbuff_unpack_bytes(sb_packbuff* pb, size_t* length, int* error) {
  struct item it;
  int e = sb_packbuff_unpack_item(pb, SB_PACKBUFF_ITEM_BYTES, &it);
  set_error(error, e);
  if (e != 0) return NULL;
  pb->item += it.step;
  if (length != NULL) *length = it.word;
  return it.payload;
}

int sb_packbuff_unpack_key_with_string_value(sb_packbuff* pb, const char** key,
                                             uint16_t* key_value_type, const char** value,
                                             size_t* value_length) {
  uint8_t* start = pb->item;
  int error;
  const char* k = sb_packbuff_unpack_string(pb, NULL, &error);
  if (error != 0) return error;
  // Peers read the pair's value type from the value item; keep doing so.
  uint16_t type = 0;
  bool has_type = sb_packbuff_get_item_value_type(pb, &type);
  const char* v = sb_packbuff_unpack_string(pb, value_length, &error);
  if (error != 0) {
    pb->item = start;
    return error;
  }
  if (key != NULL) *key = k;
  if (key_value_type != NULL && has_type) *key_value_type = type;
  if (value != NULL) *value = v;
  return 0;
}

int sb_packbuff_skip_item(sb_packbuff* pb) {
  struct item it;
  int error = read_item_at_cursor(pb, &it);
  if (error != 0) return error;
  if (it.type == SB_PACKBUFF_ITEM_END || it.type > SB_PACKBUFF_ITEM_BYTES) return EINVAL;
  error = sb_packbuff_unpack_item(pb, it.type, &it);
  if (error != 0) return error;
  pb->item += it.step;
  return 0;
}

void sb_packbuff_print(const sb_packbuff* pb) {
  static const char* const kDeallocNames[] = {"None", "free()", "vm_deallocate()"};
  printf("packbuff: %p\n", (const void*)pb);
  printf("  block_size:      %zu\n", pb->block_size);
  printf("  dealloc_type:    %s\n", pb->dealloc_type <= SB_PACKBUFF_DEALLOC_MAPPED
                                        ? kDeallocNames[pb->dealloc_type]
                                        : "<Unknown>");
  printf("  bytes_allocated: %zu\n", pb->bytes_allocated);
  printf("  bytes_used:      %zu\n", pb->bytes_used);
  printf("  bytes_remaining: %zu\n", pb->bytes_remaining);
  printf("  item_buffer %p, item: %p\n", (void*)pb->item_buffer, (void*)pb->item);
  printf("\n");

  // The walk ignores the cursor and stays inside both the used and the
  // allocated bytes, whatever sb_packbuff_set_size() was told.
  size_t limit = pb->bytes_used < pb->bytes_allocated ? pb->bytes_used : pb->bytes_allocated;
  size_t cursor = cursor_offset(pb);
  uint64_t offset = 0;
  for (int n = 0;; n++) {
    if (offset + HEADER_SIZE > limit) {
      printf(">> item pointer exceeds end of buffer. <<\n");
      return;
    }
    const uint8_t* p = pb->item_buffer + offset;
    const char* marker = offset == cursor ? "*" : " ";
    struct item it;
    read_item(p, &it);
    if (it.type == SB_PACKBUFF_ITEM_END) {
      printf("%s%3d: %p -- END\n", marker, n, (const void*)p);
      return;
    }
    printf("%s%3d:%p -- value type %u --", marker, n, (const void*)p, it.value_type);
    uint64_t next = offset + it.step;
    unsigned pad = (unsigned)(round_up(it.word) - it.word);
    switch (it.type) {
      case SB_PACKBUFF_ITEM_INLINE:
        printf("inline value: %u\n", it.word);
        break;
      case SB_PACKBUFF_ITEM_STRING:
        printf("string (%p, %u pad bytes, size: %u): \n", (const void*)it.payload, pad, it.word);
        if (next <= limit) {
          // Bounded by the payload: the string may lack its NUL.
          printf("     `");
          fwrite(it.payload, 1, strnlen((const char*)it.payload, it.word), stdout);
          printf("'\n");
        }
        break;
      case SB_PACKBUFF_ITEM_BYTES:
        printf("bytes (%p, %u pad bytes, size: %u)\n", (const void*)it.payload, pad, it.word);
        break;
      default:
        printf("*Unknown item type* %u\n", it.type);
        break;
    }
    offset = next;
  }
}

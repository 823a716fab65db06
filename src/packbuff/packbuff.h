// Packed buffers: flat, 8-byte aligned sequences of typed items. The kernel's
// container upcall and the daemon's reply travel as packed buffers, so the
// layout below is shared with the kernel and must not change.
//
// Every item starts on an 8-byte boundary from the start of the buffer with an
// 8-byte header in host byte order:
//   bytes 0-1  u16 item type (SB_PACKBUFF_ITEM_*)
//   bytes 2-3  u16 value type, a tag whose meaning the producer chooses
//   bytes 4-7  u32 inline value, or payload length for strings and bytes
// String and bytes payloads follow the header and are zero-padded to the next
// multiple of 8. A string's length counts its terminating NUL. A buffer always
// ends with an end item: eight zero bytes.
//
// Errors are errno values: 0 on success, EINVAL for a bad argument or an item
// of the wrong kind, ERANGE for an item that lies outside the buffer, ENOTSUP
// for a buffer that cannot grow, ENOMEM when growing fails. Unpacking never
// reads outside the buffer and never moves the cursor when it fails, so
// untrusted bytes can be unpacked directly. Only programming errors (a bytes
// item without data) abort the process.
//
// A handle keeps no global state and takes no locks: one thread at a time.

#ifndef QUORVAD_PACKBUFF_PACKBUFF_H_
#define QUORVAD_PACKBUFF_PACKBUFF_H_

#include <stdbool.h>
#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

typedef struct sb_packbuff sb_packbuff;

// Item types, the first header field.
#define SB_PACKBUFF_ITEM_END 0
#define SB_PACKBUFF_ITEM_INLINE 1
#define SB_PACKBUFF_ITEM_STRING 2
#define SB_PACKBUFF_ITEM_BYTES 3

// How sb_packbuff_free() releases the item buffer.
#define SB_PACKBUFF_DEALLOC_NONE 0    // the caller owns it
#define SB_PACKBUFF_DEALLOC_FREE 1    // malloc()ed; the only kind that grows
#define SB_PACKBUFF_DEALLOC_MAPPED 2  // mmap()ed by the upcall transport

// Growth quantum used when a caller asks for less than 8 bytes.
#define SB_PACKBUFF_DEFAULT_BLOCK_SIZE 256

// Returns a new, growable buffer holding only the end item (used size 8), or
// NULL when memory runs out. It grows by `block_size` bytes at a time, or by
// SB_PACKBUFF_DEFAULT_BLOCK_SIZE when `block_size` is below 8. `tag` labels
// the allocation on platforms whose allocator takes one; it is ignored here.
// Release with sb_packbuff_free().
sb_packbuff* sb_packbuff_new_with_tag(size_t block_size, uint32_t tag);
sb_packbuff* sb_packbuff_new(size_t block_size);

// Returns a handle over `size` bytes at `buffer` that never grows, or NULL
// when memory runs out or the arguments are unusable (`buffer` NULL,
// `dealloc_type` not one of SB_PACKBUFF_DEALLOC_*, or `size` below 8 without
// contents). With `has_contents` the bytes are items to unpack from the first
// one and the used size is `size`; without, an end item is written at the
// start and the used size is 8. sb_packbuff_free() releases `buffer` as
// `dealloc_type` says; for SB_PACKBUFF_DEALLOC_MAPPED, `buffer` must be the
// start of the mapping, and every page of [buffer, buffer + size) is unmapped.
sb_packbuff* sb_packbuff_init_with_buffer_and_tag(void* buffer, size_t size, bool has_contents,
                                                  uint32_t dealloc_type, uint32_t tag);
sb_packbuff* sb_packbuff_init_with_buffer(void* buffer, size_t size, bool has_contents,
                                          uint32_t dealloc_type);

// Releases the item buffer by its dealloc type, then the handle. A failed
// unmap is logged to syslog and otherwise ignored. NULL is a no-op.
void sb_packbuff_free(sb_packbuff* pb);

// The start of the items; valid until the next pack call or free. NULL after
// a failed growth.
void* sb_packbuff_get_bytes(const sb_packbuff* pb);

// Bytes in use, including the trailing end item.
size_t sb_packbuff_get_size(const sb_packbuff* pb);

// Declares `size` bytes in use, e.g. after filling sb_packbuff_get_bytes()
// by hand. Not checked: later calls refuse to touch bytes outside the
// allocation, but a wrong size gives wrong items.
void sb_packbuff_set_size(sb_packbuff* pb, size_t size);

// Packing appends one item in place of the end item and writes a new end item
// after it, growing the buffer when needed. On failure the buffer is
// unchanged. Returns ENOTSUP when a wrapped buffer is full, ENOMEM when growth
// fails (the handle then has no buffer and can only be freed), ERANGE when
// the padded payload would not fit the u32 length field.
int sb_packbuff_pack_uint32(sb_packbuff* pb, uint16_t value_type, uint32_t value);

// Packs the `length` bytes at `string` and the NUL that must follow them
// (EINVAL when string[length] is not NUL, `string` is NULL or `length` is
// above 0xFFFFFFFE). Embedded NULs are kept.
int sb_packbuff_pack_string(sb_packbuff* pb, uint16_t value_type, const char* string,
                            size_t length);

// Packs `length` bytes at `data`; `data` must not be NULL even when `length`
// is 0. EINVAL when `length` is above 0xFFFFFFFF.
int sb_packbuff_pack_bytes(sb_packbuff* pb, uint16_t value_type, const void* data, size_t length);

// Packs `key` and then `value` as two string items, stopping at the first
// error (EINVAL for a NULL string); a failure on the value leaves the key
// packed.
int sb_packbuff_pack_key_with_string_value(sb_packbuff* pb, uint16_t key_value_type,
                                           const char* key, uint16_t value_value_type,
                                           const char* value);

// Returns false when the cursor is at the end item (or outside the buffer);
// else stores the value type of the item at the cursor and returns true. The
// cursor does not move, so this drives a loop of unpack calls.
bool sb_packbuff_get_item_value_type(const sb_packbuff* pb, uint16_t* value_type);

// Unpacking reads the item at the cursor and moves past it. The error
// out-parameter may be NULL; on failure it gets ERANGE when the item or the
// item after it lies outside the buffer (an item must be followed by at least
// one more header's worth of buffer), EINVAL when the item is of another kind,
// and the cursor stays put.

// Returns the inline value, or 0 on failure.
uint32_t sb_packbuff_unpack_uint32(sb_packbuff* pb, int* error);

// Returns the string inside the buffer (NUL-terminated, not copied) and
// stores its length without the NUL; NULL on failure. EINVAL also for a
// string item of length 0 or whose last payload byte is not NUL.
const char* sb_packbuff_unpack_string(sb_packbuff* pb, size_t* length, int* error);

// Returns the payload inside the buffer and stores its length; NULL on
// failure. A zero-length payload gives a non-NULL pointer.
const void* sb_packbuff_unpack_bytes(sb_packbuff* pb, size_t* length, int* error);

// Unpacks a key string and a value string and returns the first error, with
// the cursor back before the key. `key_value_type` gets the value type of the
// value item, which is what peers of this format expect. Any out-parameter
// may be NULL.
int sb_packbuff_unpack_key_with_string_value(sb_packbuff* pb, const char** key,
                                             uint16_t* key_value_type, const char** value,
                                             size_t* value_length);

// Moves the cursor past one item of any kind. EINVAL at the end item or an
// unknown item type, ERANGE as for unpacking.
int sb_packbuff_skip_item(sb_packbuff* pb);

// Writes the handle's fields and every item to standard output, for
// debugging. Stops at the end item or at the first item that does not fit
// in the used bytes.
void sb_packbuff_print(const sb_packbuff* pb);

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // QUORVAD_PACKBUFF_PACKBUFF_H_

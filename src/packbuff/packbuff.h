// The pack buffer: the flat, self-describing byte format in which the
// kernel's sandbox and the daemon exchange the upcall's request and reply.
//
// A buffer is a run of items starting at its first byte. Every item starts at
// a multiple of 8 bytes and begins with an 8-byte header in host byte order:
//
//   offset 0  uint16  item type   (SB_PACKBUFF_ITEM_*)
//   offset 2  uint16  value type  (the caller's tag for what the item means)
//   offset 4  uint32  the value of a uint32 item, or the size in bytes of the
//                     data of a string or bytes item (a string counts its NUL)
//   offset 8          string and bytes items: the data, then zero bytes up to
//                     the next multiple of 8 (none when the size is 0)
//
// The buffer ends with one end item: 8 zero bytes. An empty buffer is exactly
// that end item. The library knows nothing of what the value types mean; the
// upcall assigns them.
//
// A record is built either as a growable buffer owned by the library, into
// which items are packed, or over memory the caller already has: a buffer to
// build into (fixed size), or a received buffer to read. Reading never copies:
// unpacked strings and bytes point into the buffer and live as long as it.
//
// Errors are POSIX error numbers, 0 for success: ENOMEM (12), EINVAL (22),
// ERANGE (34), ENOTSUP (45). A record is not safe for concurrent use.
#pragma once

#include <stdbool.h>
#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

// Every item starts at a multiple of this many bytes.
#define SB_PACKBUFF_BYTE_ALIGNMENT 8

// Item types (the first header field).
enum {
    SB_PACKBUFF_ITEM_END = 0,
    SB_PACKBUFF_ITEM_UINT32 = 1,
    SB_PACKBUFF_ITEM_STRING = 2,
    SB_PACKBUFF_ITEM_BYTES = 3,
};

// How sb_packbuff_free() releases the data buffer.
enum {
    // Not released: the memory stays the caller's.
    SB_PACKBUFF_DEALLOC_NONE = 0,
    // Released to the general-purpose heap (free()).
    SB_PACKBUFF_DEALLOC_FREE = 1,
    // Released as mapped memory of the process, as the upcall delivers a
    // received buffer: unmapped, `bytes_allocated` bytes long.
    SB_PACKBUFF_DEALLOC_VM = 2,
};

typedef struct sb_packbuff {
    // One of SB_PACKBUFF_DEALLOC_*.
    uint32_t dealloc_type;
    // Growth quantum in bytes; 0 when the buffer cannot grow.
    size_t block_size;
    // Size of the data buffer.
    size_t bytes_allocated;
    // bytes_allocated - bytes_used.
    size_t bytes_remaining;
    // Bytes of items in the buffer; while building, this counts the end item.
    size_t bytes_used;
    // Start of the data buffer.
    uint8_t* item_buffer;
    // The cursor. While building, the end item where the next item goes
    // (always item_buffer + bytes_used - 8); while reading, the next item.
    uint8_t* item;
} sb_packbuff;

// A new, empty, growable buffer that grows by at least `block_size` bytes at
// a time (block sizes below 8 mean 256). Its data is released with free().
// Returns NULL when out of memory. The tag is accepted and not used.
sb_packbuff* sb_packbuff_new_with_tag(size_t block_size, int tag);
sb_packbuff* sb_packbuff_new(size_t block_size);

// A record over `size` bytes of the caller's `data`, which is never grown and
// is released by sb_packbuff_free() as `dealloc_type` says. With
// `holds_items` false the memory becomes an empty buffer to build into (an
// end item is written at its start); with `holds_items` true it is a
// received buffer of `size` bytes, read from its first item. Returns NULL
// when out of memory, when an empty buffer would not fit (size below 8), or
// when `data` is NULL and `size` is not 0. The tag is accepted and not used.
sb_packbuff* sb_packbuff_init_with_buffer_and_tag(void* data, size_t size, bool holds_items,
                                                  uint32_t dealloc_type, int tag);
sb_packbuff* sb_packbuff_init_with_buffer(void* data, size_t size, bool holds_items,
                                          uint32_t dealloc_type);

// Releases the data as the record's dealloc type says, then the record. When
// mapped memory cannot be unmapped, prints "failed: vm_deallocate(%p, %zu)\n"
// to standard output (and the record is still released). NULL is ignored.
void sb_packbuff_free(sb_packbuff* pb);

// The data buffer and the bytes of items in it (the end item included while
// building): what is sent as the buffer.
void* sb_packbuff_get_bytes(const sb_packbuff* pb);
size_t sb_packbuff_get_size(const sb_packbuff* pb);

// Declares `size` bytes used, e.g. after the caller wrote into the data
// buffer itself; `size` must not exceed bytes_allocated. Neither the data nor
// the cursor changes.
void sb_packbuff_set_size(sb_packbuff* pb, size_t size);

// False when the item under the cursor is the end item (or the cursor has no
// whole item header left in the buffer); else true, with the item's value type
// stored through `value_type` if it is not NULL. The cursor does not move.
bool sb_packbuff_get_item_value_type(const sb_packbuff* pb, uint16_t* value_type);

// Packing appends one item in place of the end item and writes a new end item
// after it, growing a growable buffer as needed. On any error the buffer and
// the record are unchanged, except after ENOMEM from a failed growth: the
// buffer's data is then released and every later pack fails with ENOMEM.
// Errors: ENOTSUP when the item does not fit a buffer that cannot grow;
// ERANGE when the item would be longer than a 32-bit size can say. The data
// to pack must not lie inside the buffer itself: growing may move it.

// A uint32 item: the value sits in the header.
int sb_packbuff_pack_uint32(sb_packbuff* pb, uint16_t value_type, uint32_t value);

// A string item of `length` bytes of `string` plus its NUL. EINVAL when
// `length` is SIZE_MAX or string[length] is not NUL. `string` must not be NULL.
int sb_packbuff_pack_string(sb_packbuff* pb, uint16_t value_type, const char* string,
                            size_t length);

// A bytes item: a copy of `size` bytes of `data`, which must not be NULL.
int sb_packbuff_pack_bytes(sb_packbuff* pb, uint16_t value_type, const void* data, uint32_t size);

// A key and its value: two string items, the key first. Stops at and returns
// the first error, so a failed value may leave the key packed. Neither string
// may be NULL.
int sb_packbuff_pack_key_with_string_value(sb_packbuff* pb, uint16_t key_value_type,
                                           const char* key, uint16_t value_value_type,
                                           const char* value);

// Unpacking reads the item under the cursor and moves the cursor past it.
// Errors are stored through `error` when it is not NULL (0 on success), and
// every out-parameter may be NULL. Errors:
//  - ERANGE: the cursor is outside the buffer, or the item runs to or past
//    its end (a well-formed buffer always has its end item after the last
//    item); the cursor does not move.
//  - EINVAL: the item is of another type (the end item included); the cursor
//    does not move. A string item whose size is 0 or whose last data byte is
//    not NUL also gives EINVAL, but it is consumed: the cursor moves past it.
// A received buffer can hold any bytes; no input makes these read outside
// the buffer's bytes_allocated bytes.

// The value of a uint32 item, or 0 on error.
uint32_t sb_packbuff_unpack_uint32(sb_packbuff* pb, int* error);

// The NUL-terminated string of a string item inside the buffer, and its
// length without the NUL; NULL and length 0 on error. The string may hold
// NULs of its own: the length is the item's size less one.
const char* sb_packbuff_unpack_string(sb_packbuff* pb, size_t* length, int* error);

// The data of a bytes item inside the buffer, and its size; NULL and size 0
// on error.
const void* sb_packbuff_unpack_bytes(sb_packbuff* pb, uint32_t* size, int* error);

// A key and its value as packed by sb_packbuff_pack_key_with_string_value():
// the key string, then (unless the key was the last item) the value type of
// the next item, then that item as the value string and its length. Returns
// the first error; what was read before it has been reported and consumed.
int sb_packbuff_unpack_key_with_string_value(sb_packbuff* pb, const char** key,
                                             uint16_t* value_value_type, const char** value,
                                             size_t* value_length);

// Writes a dump of the record and of every item, from the first one, to
// standard output; the item under the cursor is marked with "*". The walk
// stops at the end item or where an item runs past bytes_used.
void sb_packbuff_print(const sb_packbuff* pb);

#ifdef __cplusplus
}  // extern "C"
#endif

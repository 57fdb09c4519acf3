#include "packbuff/packbuff.h"

#include <sys/mman.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace {

constexpr size_t BYTE_ALIGNMENT = SB_PACKBUFF_BYTE_ALIGNMENT;
constexpr size_t kHeaderSize = 8;
constexpr size_t kDefaultBlockSize = 256;
// Data plus pad may not exceed this, so that a whole item's length fits in
// 32 bits.
constexpr size_t kMaxPaddedDataSize = 0xFFFFFFF7;

// A broken assertion is a caller's programming error: it is reported on
// stderr and the process stops, whatever the build type.
[[noreturn]] void assertionFailed(const char* text, const char* file, int line,
                                  const char* function) {
    std::fprintf(stderr, "%s:%d: %s: Assertion `%s' failed.\n", file, line, function, text);
    std::abort();
}

#define PACKBUFF_ASSERT(condition) \
    ((condition) ? (void)0 : assertionFailed(#condition, __FILE__, __LINE__, __func__))

struct ItemHeader {
    uint16_t item_type;
    uint16_t value_type;
    uint32_t value;  // the inline value, or the size of the data
};

// Headers are copied field by field, so a caller's buffer need not be
// aligned for the reads and writes to be well defined.
ItemHeader readHeader(const uint8_t* at) {
    ItemHeader header;
    std::memcpy(&header.item_type, at, 2);
    std::memcpy(&header.value_type, at + 2, 2);
    std::memcpy(&header.value, at + 4, 4);
    return header;
}

void writeHeader(uint8_t* at, uint16_t item_type, uint16_t value_type, uint32_t value) {
    std::memcpy(at, &item_type, 2);
    std::memcpy(at + 2, &value_type, 2);
    std::memcpy(at + 4, &value, 4);
}

void writeEndItem(uint8_t* at) {
    std::memset(at, 0, kHeaderSize);
}

// Zero bytes that follow `size` bytes of data so the next item is aligned.
size_t padFor(uint64_t size) {
    return (BYTE_ALIGNMENT - size % BYTE_ALIGNMENT) % BYTE_ALIGNMENT;
}

bool carriesData(uint16_t item_type) {
    return item_type == SB_PACKBUFF_ITEM_STRING || item_type == SB_PACKBUFF_ITEM_BYTES;
}

// The cursor's offset in the data buffer, if a whole item header lies there.
bool cursorOffset(const sb_packbuff* pb, size_t* offset) {
    uintptr_t start = reinterpret_cast<uintptr_t>(pb->item_buffer);
    uintptr_t cursor = reinterpret_cast<uintptr_t>(pb->item);
    if (cursor < start || cursor - start >= pb->bytes_allocated) return false;
    if (pb->bytes_allocated - (cursor - start) < kHeaderSize) return false;
    *offset = cursor - start;
    return true;
}

// Enlarges a growable buffer by one block, and by `n` bytes (padded) more
// when one block would not leave room for them. Only memory the library
// allocated itself can grow. If the memory cannot be had, the items are
// released and the record is left without data (see packItem()).
int grow(sb_packbuff* pb, size_t n) {
    if (pb->block_size == 0 || pb->dealloc_type != SB_PACKBUFF_DEALLOC_FREE) return ENOTSUP;
    size_t needed = n + padFor(n);
    size_t allocated;
    if (__builtin_add_overflow(pb->bytes_allocated, pb->block_size, &allocated)) return ENOMEM;
    if (needed > allocated - pb->bytes_used &&
        __builtin_add_overflow(allocated, needed, &allocated)) {
        return ENOMEM;
    }
    void* data = std::realloc(pb->item_buffer, allocated);
    if (data == nullptr) {
        std::free(pb->item_buffer);
        pb->item_buffer = nullptr;
        pb->item = nullptr;
        pb->bytes_allocated = pb->bytes_used = pb->bytes_remaining = 0;
        return ENOMEM;
    }
    pb->item_buffer = static_cast<uint8_t*>(data);
    pb->bytes_allocated = allocated;
    pb->bytes_remaining = allocated - pb->bytes_used;
    pb->item = pb->item_buffer + (pb->bytes_used == 0 ? 0 : pb->bytes_used - kHeaderSize);
    return 0;
}

// Writes one item over the end item and a new end item after it. Nothing is
// written unless the whole item fits.
int packItem(sb_packbuff* pb, uint16_t item_type, uint16_t value_type, uint32_t inline_value,
             const void* additional_bytes, size_t extra_bytes_needed) {
    if (item_type > SB_PACKBUFF_ITEM_BYTES) return EINVAL;
    // A growable buffer without data lost its items when growing failed;
    // packing more would send a buffer with a hole in it.
    if (pb->item_buffer == nullptr && pb->block_size != 0) return ENOMEM;
    size_t pad = 0;
    size_t length = kHeaderSize;
    if (extra_bytes_needed > 0) {
        pad = padFor(extra_bytes_needed);
        if (extra_bytes_needed > kMaxPaddedDataSize - pad) return ERANGE;
        length += extra_bytes_needed + pad;
    }
    if (length > pb->bytes_remaining) {
        int error = grow(pb, length);
        if (error != 0) return error;
    }
    if (carriesData(item_type)) {
        PACKBUFF_ASSERT(additional_bytes != NULL);
        writeHeader(pb->item, item_type, value_type, static_cast<uint32_t>(extra_bytes_needed));
        if (extra_bytes_needed > 0) {
            std::memcpy(pb->item + kHeaderSize, additional_bytes, extra_bytes_needed);
            std::memset(pb->item + kHeaderSize + extra_bytes_needed, 0, pad);
        }
    } else {
        PACKBUFF_ASSERT(extra_bytes_needed == 0);
        writeHeader(pb->item, item_type, value_type, inline_value);
    }
    pb->bytes_remaining -= length;
    pb->bytes_used += length;
    pb->item += length;
    writeEndItem(pb->item);
    return 0;
}

// Reads the item under the cursor if it is of `item_type` and lies, with the
// start of the next item, inside the buffer; only then does the cursor move.
int unpackItem(sb_packbuff* pb, uint16_t item_type, uint32_t* inline_value, const uint8_t** data,
               uint32_t* size) {
    size_t offset;
    if (!cursorOffset(pb, &offset)) return ERANGE;
    ItemHeader header = readHeader(pb->item);
    if (header.item_type != item_type) return EINVAL;
    uint64_t bytes_to_advance = kHeaderSize;
    if (carriesData(item_type)) {
        if (data == nullptr || size == nullptr) return EINVAL;
        bytes_to_advance += header.value + padFor(header.value);
    } else if (item_type == SB_PACKBUFF_ITEM_UINT32) {
        if (inline_value == nullptr) return EINVAL;
    } else {
        return EINVAL;
    }
    if (bytes_to_advance >= pb->bytes_allocated - offset) return ERANGE;
    PACKBUFF_ASSERT((bytes_to_advance % BYTE_ALIGNMENT) == 0);
    if (carriesData(item_type)) {
        *data = pb->item + kHeaderSize;
        *size = header.value;
    } else {
        *inline_value = header.value;
    }
    pb->item += bytes_to_advance;
    return 0;
}

void report(int* error, int value) {
    if (error != nullptr) *error = value;
}

const char* deallocTypeName(uint32_t dealloc_type) {
    switch (dealloc_type) {
        case SB_PACKBUFF_DEALLOC_NONE:
            return "None";
        case SB_PACKBUFF_DEALLOC_FREE:
            return "free()";
        case SB_PACKBUFF_DEALLOC_VM:
            return "vm_deallocate()";
        default:
            return "<Unknown>";
    }
}

// Prints one item's line and returns its length, or 0 for the end item.
uint64_t printItem(const sb_packbuff* pb, const uint8_t* at, int index, size_t readable) {
    const char* prefix = at == pb->item ? "*" : " ";
    ItemHeader header = readHeader(at);
    if (header.item_type == SB_PACKBUFF_ITEM_END) {
        std::printf("%s%3d: %p -- END\n", prefix, index, static_cast<const void*>(at));
        return 0;
    }
    std::printf("%s%3d:%p -- value type %u --", prefix, index, static_cast<const void*>(at),
                unsigned{header.value_type});
    const uint8_t* data = at + kHeaderSize;
    unsigned pad = static_cast<unsigned>(padFor(header.value));
    switch (header.item_type) {
        case SB_PACKBUFF_ITEM_UINT32:
            std::printf("inline value: %u\n", header.value);
            return kHeaderSize;
        case SB_PACKBUFF_ITEM_STRING: {
            std::printf("string (%p, %u pad bytes, size: %u): \n     ",
                        static_cast<const void*>(data), pad, header.value);
            // A damaged string is cut at the end of its data or of the
            // buffer, where a well-formed one ends at its NUL anyway.
            size_t limit =
                header.value < readable - kHeaderSize ? header.value : readable - kHeaderSize;
            size_t length = strnlen(reinterpret_cast<const char*>(data), limit);
            std::printf("`");
            std::fwrite(data, 1, length, stdout);
            std::printf("'\n");
            return kHeaderSize + uint64_t{header.value} + pad;
        }
        case SB_PACKBUFF_ITEM_BYTES:
            std::printf("bytes (%p, %u pad bytes, size: %u)\n", static_cast<const void*>(data), pad,
                        header.value);
            return kHeaderSize + uint64_t{header.value} + pad;
        default:
            std::printf("*Unknown item type* %u\n", unsigned{header.item_type});
            return kHeaderSize;
    }
}

}  // namespace

extern "C" {

sb_packbuff* sb_packbuff_new_with_tag(size_t block_size, int /*tag*/) {
    auto* pb = static_cast<sb_packbuff*>(std::calloc(1, sizeof(sb_packbuff)));
    if (pb == nullptr) return nullptr;
    pb->block_size = block_size < BYTE_ALIGNMENT ? kDefaultBlockSize : block_size;
    pb->dealloc_type = SB_PACKBUFF_DEALLOC_FREE;
    if (grow(pb, 0) != 0) {
        std::free(pb);
        return nullptr;
    }
    writeEndItem(pb->item_buffer);
    pb->bytes_used = kHeaderSize;
    pb->bytes_remaining = pb->bytes_allocated - kHeaderSize;
    pb->item = pb->item_buffer;
    return pb;
}

sb_packbuff* sb_packbuff_new(size_t block_size) {
    return sb_packbuff_new_with_tag(block_size, 0);
}

sb_packbuff* sb_packbuff_init_with_buffer_and_tag(void* data, size_t size, bool holds_items,
                                                  uint32_t dealloc_type, int /*tag*/) {
    if (data == nullptr && size != 0) return nullptr;
    if (!holds_items && size < kHeaderSize) return nullptr;
    auto* pb = static_cast<sb_packbuff*>(std::calloc(1, sizeof(sb_packbuff)));
    if (pb == nullptr) return nullptr;
    pb->dealloc_type = dealloc_type;
    pb->block_size = 0;
    pb->item_buffer = pb->item = static_cast<uint8_t*>(data);
    pb->bytes_allocated = size;
    if (holds_items) {
        pb->bytes_used = size;
    } else {
        writeEndItem(pb->item_buffer);
        pb->bytes_used = kHeaderSize;
    }
    pb->bytes_remaining = size - pb->bytes_used;
    return pb;
}

sb_packbuff* sb_packbuff_init_with_buffer(void* data, size_t size, bool holds_items,
                                          uint32_t dealloc_type) {
    return sb_packbuff_init_with_buffer_and_tag(data, size, holds_items, dealloc_type, 0);
}

void sb_packbuff_free(sb_packbuff* pb) {
    if (pb == nullptr) return;
    switch (pb->dealloc_type) {
        case SB_PACKBUFF_DEALLOC_VM:
            if (munmap(pb->item_buffer, pb->bytes_allocated) != 0) {
                std::printf("failed: vm_deallocate(%p, %zu)\n", static_cast<void*>(pb->item_buffer),
                            pb->bytes_allocated);
            }
            break;
        case SB_PACKBUFF_DEALLOC_FREE:
            std::free(pb->item_buffer);
            break;
        default:
            break;
    }
    std::free(pb);
}

void* sb_packbuff_get_bytes(const sb_packbuff* pb) {
    return pb->item_buffer;
}

size_t sb_packbuff_get_size(const sb_packbuff* pb) {
    return pb->bytes_used;
}

void sb_packbuff_set_size(sb_packbuff* pb, size_t size) {
    pb->bytes_used = size;
    pb->bytes_remaining = pb->bytes_allocated - size;
}

bool sb_packbuff_get_item_value_type(const sb_packbuff* pb, uint16_t* value_type) {
    size_t offset;
    if (!cursorOffset(pb, &offset)) return false;
    ItemHeader header = readHeader(pb->item);
    if (header.item_type == SB_PACKBUFF_ITEM_END) return false;
    if (value_type != nullptr) *value_type = header.value_type;
    return true;
}

int sb_packbuff_pack_uint32(sb_packbuff* pb, uint16_t value_type, uint32_t value) {
    return packItem(pb, SB_PACKBUFF_ITEM_UINT32, value_type, value, nullptr, 0);
}

int sb_packbuff_pack_string(sb_packbuff* pb, uint16_t value_type, const char* string,
                            size_t length) {
    if (length == SIZE_MAX) return EINVAL;
    // A missing string is left to packItem()'s assertion.
    if (string != nullptr && string[length] != '\0') return EINVAL;
    return packItem(pb, SB_PACKBUFF_ITEM_STRING, value_type, 0, string, length + 1);
}

int sb_packbuff_pack_bytes(sb_packbuff* pb, uint16_t value_type, const void* data, uint32_t size) {
    return packItem(pb, SB_PACKBUFF_ITEM_BYTES, value_type, 0, data, size);
}

int sb_packbuff_pack_key_with_string_value(sb_packbuff* pb, uint16_t key_value_type,
                                           const char* key, uint16_t value_value_type,
                                           const char* value) {
    int error = sb_packbuff_pack_string(pb, key_value_type, key, key ? std::strlen(key) : 0);
    if (error != 0) return error;
    return sb_packbuff_pack_string(pb, value_value_type, value, value ? std::strlen(value) : 0);
}

uint32_t sb_packbuff_unpack_uint32(sb_packbuff* pb, int* error) {
    uint32_t value = 0;
    int result = unpackItem(pb, SB_PACKBUFF_ITEM_UINT32, &value, nullptr, nullptr);
    report(error, result);
    return result == 0 ? value : 0;
}

const char* sb_packbuff_unpack_string(sb_packbuff* pb, size_t* length, int* error) {
    const uint8_t* data = nullptr;
    uint32_t size = 0;
    int result = unpackItem(pb, SB_PACKBUFF_ITEM_STRING, nullptr, &data, &size);
    if (result == 0 && (size == 0 || data[size - 1] != '\0')) result = EINVAL;
    report(error, result);
    if (length != nullptr) *length = result == 0 ? size - 1 : 0;
    return result == 0 ? reinterpret_cast<const char*>(data) : nullptr;
}

const void* sb_packbuff_unpack_bytes(sb_packbuff* pb, uint32_t* size, int* error) {
    const uint8_t* data = nullptr;
    uint32_t data_size = 0;
    int result = unpackItem(pb, SB_PACKBUFF_ITEM_BYTES, nullptr, &data, &data_size);
    report(error, result);
    if (size != nullptr) *size = result == 0 ? data_size : 0;
    return result == 0 ? data : nullptr;
}

int sb_packbuff_unpack_key_with_string_value(sb_packbuff* pb, const char** key,
                                             uint16_t* value_value_type, const char** value,
                                             size_t* value_length) {
    int error;
    const char* key_string = sb_packbuff_unpack_string(pb, nullptr, &error);
    if (error != 0) return error;
    if (key != nullptr) *key = key_string;
    uint16_t value_type;
    if (sb_packbuff_get_item_value_type(pb, &value_type) && value_value_type != nullptr) {
        *value_value_type = value_type;
    }
    size_t length;
    const char* value_string = sb_packbuff_unpack_string(pb, &length, &error);
    if (error != 0) return error;
    if (value != nullptr) *value = value_string;
    if (value_length != nullptr) *value_length = length;
    return 0;
}

void sb_packbuff_print(const sb_packbuff* pb) {
    std::printf("packbuff: %p\n", static_cast<const void*>(pb));
    std::printf("  block_size:      %zu\n", pb->block_size);
    std::printf("  dealloc_type:    %s\n", deallocTypeName(pb->dealloc_type));
    std::printf("  bytes_allocated: %zu\n", pb->bytes_allocated);
    std::printf("  bytes_used:      %zu\n", pb->bytes_used);
    std::printf("  bytes_remaining: %zu\n", pb->bytes_remaining);
    std::printf("  item_buffer %p, item: %p\n", static_cast<void*>(pb->item_buffer),
                static_cast<void*>(pb->item));
    std::printf("\n");
    // The walk reads no byte past bytes_used (nor past the allocation), so
    // the dump of a damaged received buffer stops where the damage begins.
    const uintptr_t start = reinterpret_cast<uintptr_t>(pb->item_buffer);
    const size_t end = pb->bytes_used < pb->bytes_allocated ? pb->bytes_used : pb->bytes_allocated;
    uint64_t offset = 0;
    for (int index = 0;; ++index) {
        if (offset > UINTPTR_MAX - start) {
            std::printf(">> item pointer overflow. <<\n");
            return;
        }
        if (offset > end || end - offset < kHeaderSize) {
            std::printf(">> item pointer exceeds end of buffer. <<\n");
            return;
        }
        uint64_t length = printItem(pb, pb->item_buffer + offset, index, end - offset);
        if (length == 0) return;
        offset += length;
    }
}

}  // extern "C"

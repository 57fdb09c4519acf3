// Feeds arbitrary bytes to the pack buffer as the upcall would receive them,
// and builds buffers from them.
//
// Checked on every input:
//  - the whole input, as a received buffer (over an exact-size copy, so any
//    read past its end is caught), is walked with every unpack function, the
//    item's value type choosing which to try first: results lie inside the
//    buffer, strings end in a NUL there, failures are EINVAL or ERANGE and
//    leave the cursor where it was (a malformed string is consumed), and the
//    walk ends; the dump of the buffer reads nothing outside it either;
//  - the input read as a list of items, packed into a growable buffer (all
//    packs succeed, growth follows the block rule) and into a small buffer
//    of fixed size (a pack that does not fit fails with ENOTSUP and changes
//    nothing), reads back as exactly those items.
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "packbuff/packbuff.h"

namespace {

void check(bool condition) {
    if (!condition) __builtin_trap();
}

// A malloc'd exact-size copy: aligned for any item, and bounded for the
// address sanitizer.
uint8_t* copyOf(const uint8_t* data, size_t size) {
    auto* copy = static_cast<uint8_t*>(std::malloc(size == 0 ? 1 : size));
    check(copy != nullptr);
    if (size > 0) std::memcpy(copy, data, size);
    return copy;
}

bool inside(const uint8_t* start, size_t size, const void* p, size_t n) {
    auto* at = static_cast<const uint8_t*>(p);
    return at >= start && at <= start + size && n <= size_t(start + size - at);
}

// A NUL-terminated string lying wholly inside the buffer.
bool stringInside(const uint8_t* start, size_t size, const char* s) {
    return inside(start, size, s, 1) &&
           std::memchr(s, 0, size - (reinterpret_cast<const uint8_t*>(s) - start)) != nullptr;
}

// Tries unpack function `op` at the cursor; returns its error.
int unpackOne(sb_packbuff* pb, int op, const uint8_t* start, size_t size) {
    uint8_t* before = pb->item;
    int error = -1;
    switch (op) {
        case 0: {
            uint32_t value = sb_packbuff_unpack_uint32(pb, &error);
            check(error == 0 || value == 0);
            check(error != 0 || pb->item == before + 8);
            break;
        }
        case 1: {
            size_t length = 1;
            const char* s = sb_packbuff_unpack_string(pb, &length, &error);
            if (error == 0) {
                check(inside(start, size, s, length + 1) && s[length] == '\0');
            } else {
                check(s == nullptr && length == 0);
            }
            break;
        }
        case 2: {
            uint32_t n = 1;
            const void* bytes = sb_packbuff_unpack_bytes(pb, &n, &error);
            check(error == 0 ? inside(start, size, bytes, n) : bytes == nullptr && n == 0);
            break;
        }
        default: {
            const char* key = nullptr;
            const char* value = nullptr;
            size_t length = 0;
            uint16_t type = 0;
            error = sb_packbuff_unpack_key_with_string_value(pb, &key, &type, &value, &length);
            check(key == nullptr || stringInside(start, size, key));
            if (error == 0) check(inside(start, size, value, length + 1) && value[length] == '\0');
            // A key read before the value failed stays consumed.
            if (key != nullptr) check(pb->item > before);
            if (key == nullptr && error == ERANGE) check(pb->item == before);
            break;
        }
    }
    check(error == 0 || error == EINVAL || error == ERANGE);
    if (error != 0 && op != 3 && (error == ERANGE || op != 1)) check(pb->item == before);
    // Every read leaves the cursor on an item inside the buffer.
    if (error == 0) check(pb->item > before && pb->item < start + size);
    check(inside(start, size, pb->item, 0));
    check((pb->item - start) % SB_PACKBUFF_BYTE_ALIGNMENT == 0);
    return error;
}

void walkReceived(const uint8_t* data, size_t size) {
    uint8_t* copy = copyOf(data, size);
    sb_packbuff* pb = sb_packbuff_init_with_buffer(copy, size, true, SB_PACKBUFF_DEALLOC_NONE);
    check(pb != nullptr);
    sb_packbuff_print(pb);
    for (unsigned step = 0;; ++step) {
        uint16_t value_type = 0;
        bool more = sb_packbuff_get_item_value_type(pb, &value_type);
        uint8_t* before = pb->item;
        for (int k = 0; k < 4 && pb->item == before; ++k) {
            unpackOne(pb, (value_type + step + k) % 4, copy, size);
        }
        if (pb->item == before) break;
        check(more);  // nothing reads past the end item
    }
    sb_packbuff_print(pb);
    sb_packbuff_free(pb);
    std::free(copy);
}

// The input read as items to pack.
struct Item {
    enum Kind { Uint32, String, Bytes, Pair } kind;
    uint16_t value_type;
    uint32_t value;
    std::string text, text2;  // text2: the value of a pair
    uint16_t value_type2;
};

class Reader {
  public:
    Reader(const uint8_t* data, size_t size) : data_(data), size_(size) {}
    bool done() const { return pos_ >= size_; }
    uint32_t next(int bytes) {
        uint32_t v = 0;
        for (int i = 0; i < bytes; ++i) v |= uint32_t{pos_ < size_ ? data_[pos_++] : 0u} << (8 * i);
        return v;
    }
    std::string text() {
        size_t n = next(1);
        if (n > size_ - pos_) n = size_ - pos_;
        std::string s(reinterpret_cast<const char*>(data_ + pos_), n);
        pos_ += n;
        return s;
    }

  private:
    const uint8_t* data_;
    size_t size_;
    size_t pos_ = 0;
};

std::vector<Item> itemsOf(const uint8_t* data, size_t size) {
    Reader in(data, size);
    std::vector<Item> items;
    while (!in.done() && items.size() < 64) {
        Item item{};
        item.kind = Item::Kind(in.next(1) % 4);
        item.value_type = uint16_t(in.next(2));
        if (item.kind == Item::Uint32) item.value = in.next(4);
        if (item.kind != Item::Uint32) item.text = in.text();
        if (item.kind == Item::Pair) {
            item.text = item.text.c_str();  // the pair's strings are packed up to a NUL
            item.value_type2 = uint16_t(in.next(2));
            item.text2 = in.text().c_str();
        }
        items.push_back(item);
    }
    return items;
}

int pack(sb_packbuff* pb, const Item& item) {
    switch (item.kind) {
        case Item::Uint32:
            return sb_packbuff_pack_uint32(pb, item.value_type, item.value);
        case Item::String:
            return sb_packbuff_pack_string(pb, item.value_type, item.text.c_str(),
                                           item.text.size());
        case Item::Bytes:
            return sb_packbuff_pack_bytes(pb, item.value_type, item.text.data(),
                                          uint32_t(item.text.size()));
        default:
            return sb_packbuff_pack_key_with_string_value(pb, item.value_type, item.text.c_str(),
                                                          item.value_type2, item.text2.c_str());
    }
}

size_t itemLength(size_t dataSize) {
    return 8 + (dataSize + 7) / 8 * 8;
}

size_t lengthOf(const Item& item) {
    switch (item.kind) {
        case Item::Uint32:
            return 8;
        case Item::String:
            return itemLength(item.text.size() + 1);
        case Item::Bytes:
            return itemLength(item.text.size());
        default:
            return itemLength(item.text.size() + 1) + itemLength(item.text2.size() + 1);
    }
}

void checkBuilding(const sb_packbuff* pb) {
    check(pb->bytes_used % 8 == 0 && pb->bytes_used >= 8);
    check(pb->bytes_used + pb->bytes_remaining == pb->bytes_allocated);
    check(pb->item == pb->item_buffer + pb->bytes_used - 8);
    static const uint8_t end[8] = {};
    check(std::memcmp(pb->item, end, 8) == 0);
}

// Reads the built buffer's bytes back as a received buffer.
void readBack(const sb_packbuff* built, const std::vector<Item>& items) {
    size_t size = sb_packbuff_get_size(built);
    uint8_t* copy = copyOf(static_cast<const uint8_t*>(sb_packbuff_get_bytes(built)), size);
    sb_packbuff* pb = sb_packbuff_init_with_buffer(copy, size, true, SB_PACKBUFF_DEALLOC_FREE);
    check(pb != nullptr);
    for (const Item& item : items) {
        uint16_t value_type = 0;
        check(sb_packbuff_get_item_value_type(pb, &value_type) && value_type == item.value_type);
        int error = -1;
        switch (item.kind) {
            case Item::Uint32:
                check(sb_packbuff_unpack_uint32(pb, &error) == item.value && error == 0);
                break;
            case Item::String: {
                size_t length = 0;
                const char* s = sb_packbuff_unpack_string(pb, &length, &error);
                check(error == 0 && std::string(s, length) == item.text);
                break;
            }
            case Item::Bytes: {
                uint32_t n = 0;
                const void* bytes = sb_packbuff_unpack_bytes(pb, &n, &error);
                check(error == 0 && n == item.text.size() &&
                      (n == 0 || std::memcmp(bytes, item.text.data(), n) == 0));
                break;
            }
            default: {
                const char *key = nullptr, *value = nullptr;
                size_t length = 0;
                uint16_t type = 0;
                check(sb_packbuff_unpack_key_with_string_value(pb, &key, &type, &value, &length) ==
                      0);
                check(key == item.text && type == item.value_type2 && value == item.text2 &&
                      length == item.text2.size());
            }
        }
    }
    check(!sb_packbuff_get_item_value_type(pb, nullptr));
    check(pb->item == copy + size - 8);
    sb_packbuff_free(pb);  // releases the copy to the heap
}

void roundTrip(const uint8_t* data, size_t size) {
    std::vector<Item> items = itemsOf(data, size);
    size_t block = size > 0 ? data[0] % 64 : 0;

    // Growable: every pack succeeds and grows by the block rule.
    sb_packbuff* pb = sb_packbuff_new(block);
    check(pb != nullptr);
    for (const Item& item : items) {
        size_t allocated = pb->bytes_allocated;
        size_t remaining = pb->bytes_remaining;
        check(pack(pb, item) == 0);
        checkBuilding(pb);
        if (item.kind != Item::Pair) {
            size_t length = lengthOf(item);
            size_t grown = allocated;
            if (length > remaining) {
                grown += pb->block_size;
                if (length > grown - (pb->bytes_used - length)) grown += length;
            }
            check(pb->bytes_allocated == grown);
        }
    }
    readBack(pb, items);
    sb_packbuff_free(pb);

    // Fixed: what does not fit is refused and leaves everything as it was.
    size_t fixed = 8 + (size > 1 ? data[1] : 0);
    std::vector<uint8_t> memory(fixed, 0xAA);
    pb = sb_packbuff_init_with_buffer(memory.data(), fixed, false, SB_PACKBUFF_DEALLOC_NONE);
    check(pb != nullptr);
    std::vector<Item> packed;
    for (const Item& item : items) {
        std::vector<uint8_t> before = memory;
        size_t used = pb->bytes_used;
        int error = pack(pb, item);
        checkBuilding(pb);
        if (error == 0) {
            check(pb->bytes_used == used + lengthOf(item));
            packed.push_back(item);
            continue;
        }
        check(error == ENOTSUP);
        check(lengthOf(item) > fixed - used);
        if (pb->bytes_used != used) {
            // A pair whose key fitted and whose value did not.
            check(item.kind == Item::Pair);
            packed.push_back({Item::String, item.value_type, 0, item.text, "", 0});
        } else {
            check(memory == before);
        }
    }
    readBack(pb, packed);
    sb_packbuff_free(pb);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    // The dumps are exercised for their reads, not their text.
    static FILE* quiet = std::freopen("/dev/null", "w", stdout);
    check(quiet != nullptr);
    walkReceived(data, size);
    roundTrip(data, size);
    return 0;
}

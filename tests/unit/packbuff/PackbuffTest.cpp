#include <gtest/gtest.h>
#include <malloc.h>
#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdarg>
#include <cstdint>
#include <cstring>
#include <functional>
#include <iterator>
#include <memory>
#include <string>
#include <vector>

#include "packbuff/packbuff.h"

// Sanitizers bring heaps of their own: no mapping to watch, no null for an
// impossible allocation.
#if defined(__SANITIZE_ADDRESS__)
#define PACKBUFF_TEST_ASAN 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
#define PACKBUFF_TEST_ASAN 1
#endif
#endif
#ifdef PACKBUFF_TEST_ASAN
#include <sanitizer/asan_interface.h>
#define PACKBUFF_TEST_SANITIZER_HEAP 1
#elif defined(__SANITIZE_THREAD__)
#define PACKBUFF_TEST_SANITIZER_HEAP 1
#elif defined(__has_feature)
#if __has_feature(thread_sanitizer) || __has_feature(memory_sanitizer)
#define PACKBUFF_TEST_SANITIZER_HEAP 1
#endif
#endif

namespace {

using Bytes = std::vector<uint8_t>;

struct Free {
    void operator()(sb_packbuff* pb) const { sb_packbuff_free(pb); }
};
using Packbuff = std::unique_ptr<sb_packbuff, Free>;

Bytes contents(const sb_packbuff* pb) {
    auto* bytes = static_cast<const uint8_t*>(sb_packbuff_get_bytes(pb));
    return Bytes(bytes, bytes + sb_packbuff_get_size(pb));
}

Bytes concat(Bytes a, const Bytes& b) {
    a.insert(a.end(), b.begin(), b.end());
    return a;
}

const Bytes kEnd(8, 0);

// Received buffers live in 8-aligned memory, as the upcall maps them.
struct Received {
    explicit Received(const Bytes& bytes) : words((bytes.size() + 7) / 8 + 1) {
        std::memcpy(words.data(), bytes.data(), bytes.size());
        pb.reset(sb_packbuff_init_with_buffer(words.data(), bytes.size(), true, 0));
    }
    size_t cursor() const { return pb->item - pb->item_buffer; }
    std::vector<uint64_t> words;
    Packbuff pb;
};

std::string printed(const char* format, ...) {
    va_list args;
    va_start(args, format);
    char text[4096];
    vsnprintf(text, sizeof text, format, args);
    va_end(args);
    return text;
}

std::string dump(const sb_packbuff* pb) {
    testing::internal::CaptureStdout();
    sb_packbuff_print(pb);
    return testing::internal::GetCapturedStdout();
}

TEST(PackbuffTest, NewBufferIsOneEndItem) {
    struct Case {
        size_t block_size, allocated;
    } cases[] = {{0, 256}, {7, 256}, {8, 8}, {100, 100}};
    for (const Case& c : cases) {
        Packbuff pb(sb_packbuff_new(c.block_size));
        ASSERT_NE(pb, nullptr);
        EXPECT_EQ(contents(pb.get()), kEnd);
        EXPECT_EQ(pb->bytes_allocated, c.allocated);
        EXPECT_EQ(pb->block_size, c.allocated);
        EXPECT_EQ(pb->bytes_remaining, c.allocated - 8);
        EXPECT_EQ(pb->item, pb->item_buffer);
        EXPECT_EQ(pb->dealloc_type, uint32_t{SB_PACKBUFF_DEALLOC_FREE});
        uint16_t value_type = 99;
        EXPECT_FALSE(sb_packbuff_get_item_value_type(pb.get(), &value_type));
    }
}

TEST(PackbuffTest, PacksExactBytes) {
    const uint8_t eight[8] = {1, 2, 3, 4, 5, 6, 7, 8};
    struct Case {
        const char* name;
        std::function<int(sb_packbuff*)> pack;
        Bytes item;
    } cases[] = {
        {"uint32",
         [](sb_packbuff* pb) { return sb_packbuff_pack_uint32(pb, 3, 5); },
         {1, 0, 3, 0, 5, 0, 0, 0}},
        {"uint32 byte order",
         [](sb_packbuff* pb) { return sb_packbuff_pack_uint32(pb, 0x1234, 0xA1B2C3D4); },
         {1, 0, 0x34, 0x12, 0xD4, 0xC3, 0xB2, 0xA1}},
        {"string",
         [](sb_packbuff* pb) { return sb_packbuff_pack_string(pb, 7, "ab", 2); },
         {2, 0, 7, 0, 3, 0, 0, 0, 'a', 'b', 0, 0, 0, 0, 0, 0}},
        {"empty string",
         [](sb_packbuff* pb) { return sb_packbuff_pack_string(pb, 1, "", 0); },
         {2, 0, 1, 0, 1, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0}},
        {"bytes of 8",
         [&](sb_packbuff* pb) { return sb_packbuff_pack_bytes(pb, 2, eight, 8); },
         {3, 0, 2, 0, 8, 0, 0, 0, 1, 2, 3, 4, 5, 6, 7, 8}},
        {"bytes of 0",
         [&](sb_packbuff* pb) { return sb_packbuff_pack_bytes(pb, 9, eight, 0); },
         {3, 0, 9, 0, 0, 0, 0, 0}},
        {"key and value",
         [](sb_packbuff* pb) {
             return sb_packbuff_pack_key_with_string_value(pb, 4, "k", 5, "vv");
         },
         {2, 0, 4, 0, 2, 0, 0, 0, 'k', 0,   0, 0, 0, 0, 0, 0,  //
          2, 0, 5, 0, 3, 0, 0, 0, 'v', 'v', 0, 0, 0, 0, 0, 0}},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        // Stale bytes in the caller's memory must not leak into pad or end item.
        Bytes memory(64, 0xAA);
        Packbuff pb(sb_packbuff_init_with_buffer(memory.data(), memory.size(), false, 0));
        ASSERT_EQ(c.pack(pb.get()), 0);
        EXPECT_EQ(contents(pb.get()), concat(c.item, kEnd));
        EXPECT_EQ(pb->item, pb->item_buffer + pb->bytes_used - 8);
        EXPECT_EQ(pb->bytes_remaining, 64 - pb->bytes_used);
    }
}

TEST(PackbuffTest, GrowsByBlocksAndByWhatDoesNotFit) {
    struct Case {
        size_t block_size;
        std::vector<uint32_t> sizes;  // of bytes items packed in turn
        std::vector<size_t> allocated;
    } cases[] = {
        {256, {1000}, {256 + 256 + 1008}},
        {256, {200, 100}, {256, 512}},
        {8, {0, 20}, {16, 16 + 8 + 32}},
        {13, {0, 0, 0}, {26, 26, 39}},
    };
    for (const Case& c : cases) {
        Packbuff pb(sb_packbuff_new(c.block_size));
        Bytes expected;
        for (size_t i = 0; i < c.sizes.size(); ++i) {
            Bytes data(c.sizes[i]);
            for (size_t k = 0; k < data.size(); ++k) data[k] = uint8_t(k * 7 + i);
            data.reserve(1);  // a pointer even for no bytes
            ASSERT_EQ(sb_packbuff_pack_bytes(pb.get(), uint16_t(i), data.data(), c.sizes[i]), 0);
            Bytes header = {3, 0, uint8_t(i), 0};
            for (int shift = 0; shift < 32; shift += 8) header.push_back(c.sizes[i] >> shift);
            expected = concat(concat(expected, header), data);
            expected.resize((expected.size() + 7) / 8 * 8, 0);
            EXPECT_EQ(pb->bytes_allocated, c.allocated[i]) << c.block_size << " item " << i;
            EXPECT_EQ(pb->bytes_remaining, pb->bytes_allocated - pb->bytes_used);
        }
        EXPECT_EQ(contents(pb.get()), concat(expected, kEnd));
    }
}

TEST(PackbuffTest, FixedBufferThatIsFullIsLeftUnchanged) {
    Bytes memory(32, 0xAA);
    Packbuff pb(sb_packbuff_init_with_buffer(memory.data(), memory.size(), false, 0));
    ASSERT_EQ(sb_packbuff_pack_uint32(pb.get(), 1, 2), 0);
    const Bytes before = memory;
    const sb_packbuff record = *pb;
    auto unchanged = [&] {
        return pb->dealloc_type == record.dealloc_type && pb->block_size == record.block_size &&
               pb->bytes_allocated == record.bytes_allocated &&
               pb->bytes_remaining == record.bytes_remaining &&
               pb->bytes_used == record.bytes_used && pb->item_buffer == record.item_buffer &&
               pb->item == record.item;
    };
    const uint8_t nine[9] = {};
    std::function<int()> packs[] = {
        [&] { return sb_packbuff_pack_string(pb.get(), 1, "abcdefghij", 10); },
        [&] { return sb_packbuff_pack_bytes(pb.get(), 1, nine, 9); },
        // A block size does not make a caller's memory the library's to grow.
        [&] {
            pb->block_size = 64;
            int error = sb_packbuff_pack_bytes(pb.get(), 1, nine, 9);
            pb->block_size = 0;
            return error;
        },
    };
    for (auto& pack : packs) {
        EXPECT_EQ(pack(), ENOTSUP);
        EXPECT_EQ(memory, before);
        EXPECT_TRUE(unchanged());
    }
    // An item that fills the buffer exactly still fits.
    EXPECT_EQ(sb_packbuff_pack_bytes(pb.get(), 1, nine, 8), 0);
    EXPECT_EQ(pb->bytes_remaining, 0u);
}

TEST(PackbuffTest, RefusedPacksChangeNothing) {
    const uint8_t data[8] = {};
    std::function<int(sb_packbuff*)> packs[] = {
        [](sb_packbuff* pb) { return sb_packbuff_pack_string(pb, 1, "abc", 2); },
        [](sb_packbuff* pb) { return sb_packbuff_pack_string(pb, 1, "abc", SIZE_MAX); },
        [&](sb_packbuff* pb) { return sb_packbuff_pack_bytes(pb, 1, data, 0xFFFFFFF1); },
        [&](sb_packbuff* pb) { return sb_packbuff_pack_bytes(pb, 1, data, 0xFFFFFFFF); },
    };
    const int errors[] = {EINVAL, EINVAL, ERANGE, ERANGE};
    for (size_t i = 0; i < std::size(packs); ++i) {
        Packbuff pb(sb_packbuff_new(0));
        EXPECT_EQ(packs[i](pb.get()), errors[i]) << i;
        EXPECT_EQ(contents(pb.get()), kEnd);
        EXPECT_EQ(pb->bytes_allocated, 256u);
    }
}

TEST(PackbuffTest, ReadsBackWhatWasBuilt) {
    Packbuff built(sb_packbuff_new(16));
    const uint8_t data[3] = {0, 0xFF, 0};
    ASSERT_EQ(sb_packbuff_pack_uint32(built.get(), 1, 0xDEADBEEF), 0);
    ASSERT_EQ(sb_packbuff_pack_string(built.get(), 2, "a\0b", 3), 0);
    ASSERT_EQ(sb_packbuff_pack_bytes(built.get(), 3, data, 3), 0);
    ASSERT_EQ(sb_packbuff_pack_bytes(built.get(), 4, data, 0), 0);
    ASSERT_EQ(sb_packbuff_pack_key_with_string_value(built.get(), 5, "group", 6, "/path/x"), 0);
    Received r(contents(built.get()));
    sb_packbuff* pb = r.pb.get();
    auto inside = [&](const void* p) {
        return p >= pb->item_buffer && p < pb->item_buffer + pb->bytes_allocated;
    };
    uint16_t type = 0;
    int error = -1;
    ASSERT_TRUE(sb_packbuff_get_item_value_type(pb, &type));
    EXPECT_EQ(type, 1);
    EXPECT_EQ(sb_packbuff_unpack_uint32(pb, &error), 0xDEADBEEF);
    EXPECT_EQ(error, 0);
    size_t length = 0;
    const char* string = sb_packbuff_unpack_string(pb, &length, &error);
    ASSERT_TRUE(inside(string));
    EXPECT_EQ(std::string(string, length + 1), std::string("a\0b", 4));
    uint32_t size = 0;
    const void* bytes = sb_packbuff_unpack_bytes(pb, &size, &error);
    ASSERT_TRUE(inside(bytes));
    EXPECT_EQ(Bytes(static_cast<const uint8_t*>(bytes), static_cast<const uint8_t*>(bytes) + size),
              Bytes(data, data + 3));
    EXPECT_NE(sb_packbuff_unpack_bytes(pb, &size, &error), nullptr);
    EXPECT_EQ(size, 0u);
    const char *key = nullptr, *value = nullptr;
    EXPECT_EQ(sb_packbuff_unpack_key_with_string_value(pb, &key, &type, &value, &length), 0);
    EXPECT_STREQ(key, "group");
    EXPECT_EQ(type, 6);
    EXPECT_STREQ(value, "/path/x");
    EXPECT_EQ(length, 7u);
    // At the end item everything fails with EINVAL and the cursor stays.
    const size_t end = r.cursor();
    EXPECT_EQ(end, pb->bytes_used - 8);
    EXPECT_FALSE(sb_packbuff_get_item_value_type(pb, &type));
    EXPECT_EQ(sb_packbuff_unpack_uint32(pb, &error), 0u);
    EXPECT_EQ(error, EINVAL);
    EXPECT_EQ(sb_packbuff_unpack_string(pb, nullptr, &error), nullptr);
    EXPECT_EQ(error, EINVAL);
    EXPECT_EQ(r.cursor(), end);
}

TEST(PackbuffTest, UnpackFailures) {
    enum Op { kUint32, kString, kBytes, kKeyValue };
    struct Case {
        const char* name;
        Bytes buffer;
        Op op;
        int error;
        size_t cursor;  // where the cursor is afterwards
    } cases[] = {
        {"string as uint32", concat({2, 0, 1, 0, 2, 0, 0, 0, 'a', 0, 0, 0, 0, 0, 0, 0}, kEnd),
         kUint32, EINVAL, 0},
        {"uint32 as bytes", concat({1, 0, 1, 0, 7, 0, 0, 0}, kEnd), kBytes, EINVAL, 0},
        {"end item as string", kEnd, kString, EINVAL, 0},
        {"unknown item type", concat({9, 0, 1, 0, 7, 0, 0, 0}, kEnd), kUint32, EINVAL, 0},
        {"size past the end", concat({3, 0, 1, 0, 64, 0, 0, 0}, kEnd), kBytes, ERANGE, 0},
        {"size of 4 GiB", concat({3, 0, 1, 0, 0xFF, 0xFF, 0xFF, 0xFF}, kEnd), kBytes, ERANGE, 0},
        {"item up to the end", concat({3, 0, 1, 0, 8, 0, 0, 0}, Bytes(8, 1)), kBytes, ERANGE, 0},
        {"no end item", {1, 0, 1, 0, 7, 0, 0, 0}, kUint32, ERANGE, 0},
        {"shorter than a header", {1, 0, 1, 0}, kUint32, ERANGE, 0},
        {"empty string", concat({2, 0, 1, 0, 0, 0, 0, 0}, kEnd), kString, EINVAL, 8},
        {"string without NUL", concat({2, 0, 1, 0, 3, 0, 0, 0, 'a', 'b', 'c', 0, 0, 0, 0, 0}, kEnd),
         kString, EINVAL, 16},
        {"key without value", concat({2, 0, 1, 0, 2, 0, 0, 0, 'k', 0, 0, 0, 0, 0, 0, 0}, kEnd),
         kKeyValue, EINVAL, 16},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        Received r(c.buffer);
        int error = -1;
        size_t length = 99;
        uint32_t size = 99;
        switch (c.op) {
            case kUint32:
                EXPECT_EQ(sb_packbuff_unpack_uint32(r.pb.get(), &error), 0u);
                break;
            case kString:
                EXPECT_EQ(sb_packbuff_unpack_string(r.pb.get(), &length, &error), nullptr);
                EXPECT_EQ(length, 0u);
                break;
            case kBytes:
                EXPECT_EQ(sb_packbuff_unpack_bytes(r.pb.get(), &size, &error), nullptr);
                EXPECT_EQ(size, 0u);
                break;
            case kKeyValue: {
                const char* key = nullptr;
                uint16_t type = 99;
                error = sb_packbuff_unpack_key_with_string_value(r.pb.get(), &key, &type, nullptr,
                                                                 nullptr);
                EXPECT_STREQ(key, "k");
                EXPECT_EQ(type, 99);
                break;
            }
        }
        EXPECT_EQ(error, c.error);
        EXPECT_EQ(r.cursor(), c.cursor);
    }
}

TEST(PackbuffTest, CursorOutsideTheBufferReadsNothing) {
    std::vector<uint64_t> words(4, 0x0000000700010001);  // uint32 items everywhere
    Packbuff pb(sb_packbuff_init_with_buffer(&words[1], 16, true, 0));
    for (uint8_t* cursor : {reinterpret_cast<uint8_t*>(&words[0]), pb->item_buffer + 16}) {
        pb->item = cursor;
        int error = 0;
        EXPECT_FALSE(sb_packbuff_get_item_value_type(pb.get(), nullptr));
        EXPECT_EQ(sb_packbuff_unpack_uint32(pb.get(), &error), 0u);
        EXPECT_EQ(error, ERANGE);
        EXPECT_EQ(pb->item, cursor);
    }
}

TEST(PackbuffTest, RecordsOverCallerMemory) {
    uint64_t words[2] = {};
    EXPECT_EQ(sb_packbuff_init_with_buffer(nullptr, 8, true, 0), nullptr);
    EXPECT_EQ(sb_packbuff_init_with_buffer(words, 7, false, 0), nullptr);
    Packbuff empty(sb_packbuff_init_with_buffer(nullptr, 0, true, 0));
    ASSERT_NE(empty, nullptr);
    EXPECT_EQ(sb_packbuff_pack_uint32(empty.get(), 1, 1), ENOTSUP);
    // A received buffer too short for a header has no item to read.
    words[0] = 0x0000000700010001;
    Packbuff stub(sb_packbuff_init_with_buffer(words, 4, true, 0));
    EXPECT_FALSE(sb_packbuff_get_item_value_type(stub.get(), nullptr));
    words[0] = ~0ull;
    Packbuff pb(sb_packbuff_init_with_buffer(words, 16, true, 0));
    EXPECT_EQ(sb_packbuff_get_size(pb.get()), 16u);
    EXPECT_EQ(pb->bytes_remaining, 0u);
    EXPECT_EQ(words[0], ~0ull);  // received items are not overwritten
    sb_packbuff_set_size(pb.get(), 8);
    EXPECT_EQ(sb_packbuff_get_size(pb.get()), 8u);
    EXPECT_EQ(pb->bytes_remaining, 8u);
}

TEST(PackbuffTest, CreateFailsCleanlyWithoutMemory) {
#ifdef PACKBUFF_TEST_SANITIZER_HEAP
    GTEST_SKIP() << "the sanitizer's heap aborts on impossible allocations";
#else
    EXPECT_EQ(sb_packbuff_new(SIZE_MAX), nullptr);
#endif
}

bool pageMapped(void* page, size_t size) {
    if (msync(page, size, MS_ASYNC) == 0) return true;
    EXPECT_EQ(errno, ENOMEM);
    return false;
}

TEST(PackbuffTest, ReleasesCallerAndMappedDataAsTheirTypeSays) {
    const size_t pageSize = sysconf(_SC_PAGESIZE);
    // 0 and unknown types leave the caller's memory alone.
    for (uint32_t type : {0u, 7u}) {
        Bytes memory(16, 0xAA);
        sb_packbuff_free(sb_packbuff_init_with_buffer(memory.data(), 16, false, type));
        EXPECT_EQ(memory, concat(kEnd, Bytes(8, 0xAA)));
    }
    // 2: mapped memory, as the upcall delivers it, is unmapped whole.
    void* mapped =
        mmap(nullptr, 2 * pageSize, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    ASSERT_NE(mapped, MAP_FAILED);
    sb_packbuff* pb = sb_packbuff_init_with_buffer(mapped, 2 * pageSize, false, 2);
    ASSERT_EQ(sb_packbuff_pack_string(pb, 1, "x", 1), 0);
    testing::internal::CaptureStdout();
    sb_packbuff_free(pb);
    EXPECT_EQ(testing::internal::GetCapturedStdout(), "");
    EXPECT_FALSE(pageMapped(mapped, 2 * pageSize));
    // Memory that cannot be unmapped is reported and stays.
    mapped = mmap(nullptr, pageSize, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    ASSERT_NE(mapped, MAP_FAILED);
    uint8_t* unaligned = static_cast<uint8_t*>(mapped) + 8;
    testing::internal::CaptureStdout();
    sb_packbuff_free(sb_packbuff_init_with_buffer(unaligned, 64, true, 2));
    EXPECT_EQ(testing::internal::GetCapturedStdout(),
              printed("failed: vm_deallocate(%p, 64)\n", static_cast<void*>(unaligned)));
    EXPECT_TRUE(pageMapped(mapped, pageSize));
    munmap(mapped, pageSize);
}

TEST(PackbuffTest, ReleasesHeapDataToTheHeap) {
#if defined(PACKBUFF_TEST_ASAN)
    void* heap = std::malloc(64);
    sb_packbuff_free(sb_packbuff_init_with_buffer(heap, 64, true, SB_PACKBUFF_DEALLOC_FREE));
    EXPECT_TRUE(__asan_address_is_poisoned(heap));
#elif defined(PACKBUFF_TEST_SANITIZER_HEAP)
    GTEST_SKIP() << "the sanitizer's heap keeps freed blocks";
#else
    // A large block is a mapping of its own, unmapped when freed.
    const size_t pageSize = sysconf(_SC_PAGESIZE);
    mallopt(M_MMAP_THRESHOLD, 128 * 1024);
    void* heap = std::malloc(1 << 20);
    void* page = reinterpret_cast<void*>(reinterpret_cast<uintptr_t>(heap) & ~(pageSize - 1));
    ASSERT_TRUE(pageMapped(page, pageSize));
    sb_packbuff_free(sb_packbuff_init_with_buffer(heap, 1 << 20, true, SB_PACKBUFF_DEALLOC_FREE));
    EXPECT_FALSE(pageMapped(page, pageSize));
#endif
}

TEST(PackbuffTest, DumpOfABuiltBuffer) {
    Packbuff pb(sb_packbuff_new(64));
    const uint8_t eight[8] = {};
    ASSERT_EQ(sb_packbuff_pack_uint32(pb.get(), 3, 5), 0);
    ASSERT_EQ(sb_packbuff_pack_string(pb.get(), 7, "ab", 2), 0);
    ASSERT_EQ(sb_packbuff_pack_bytes(pb.get(), 2, eight, 8), 0);
    uint8_t* b = pb->item_buffer;
    EXPECT_EQ(dump(pb.get()),
              printed("packbuff: %p\n"
                      "  block_size:      64\n"
                      "  dealloc_type:    free()\n"
                      "  bytes_allocated: 64\n"
                      "  bytes_used:      48\n"
                      "  bytes_remaining: 16\n"
                      "  item_buffer %p, item: %p\n"
                      "\n"
                      "   0:%p -- value type 3 --inline value: 5\n"
                      "   1:%p -- value type 7 --string (%p, 5 pad bytes, size: 3): \n"
                      "     `ab'\n"
                      "   2:%p -- value type 2 --bytes (%p, 0 pad bytes, size: 8)\n"
                      "*  3: %p -- END\n",
                      pb.get(), b, b + 40, b, b + 8, b + 16, b + 24, b + 32, b + 40, b + 40));
}

TEST(PackbuffTest, DumpOfADamagedReceivedBuffer) {
    Bytes uint32 = {1, 0, 1, 0, 7, 0, 0, 0};
    Bytes unknown = {9, 0, 4, 0, 0, 0, 0, 0};
    Bytes threeBytes = {3, 0, 5, 0, 3, 0, 0, 0, 1, 2, 3, 0, 0, 0, 0, 0};
    Bytes halfHeader = {0xFF, 0xFF, 0xFF, 0xFF};
    Received r(concat(concat(concat(uint32, unknown), threeBytes), halfHeader));
    sb_packbuff* pb = r.pb.get();
    ASSERT_EQ(sb_packbuff_unpack_uint32(pb, nullptr), 7u);
    uint8_t* b = pb->item_buffer;
    EXPECT_EQ(dump(pb), printed("packbuff: %p\n"
                                "  block_size:      0\n"
                                "  dealloc_type:    None\n"
                                "  bytes_allocated: 36\n"
                                "  bytes_used:      36\n"
                                "  bytes_remaining: 0\n"
                                "  item_buffer %p, item: %p\n"
                                "\n"
                                "   0:%p -- value type 1 --inline value: 7\n"
                                "*  1:%p -- value type 4 --*Unknown item type* 9\n"
                                "   2:%p -- value type 5 --bytes (%p, 5 pad bytes, size: 3)\n"
                                ">> item pointer exceeds end of buffer. <<\n",
                                pb, b, b + 8, b, b + 8, b + 16, b + 24));
    const char* names[] = {"None", "free()", "vm_deallocate()", "<Unknown>"};
    for (uint32_t type = 0; type < 4; ++type) {
        pb->dealloc_type = type;
        std::string text = dump(pb);
        EXPECT_NE(text.find(printed("\n  dealloc_type:    %s\n", names[type])), std::string::npos);
    }
    pb->dealloc_type = 0;
    // An item whose size runs far past the end.
    Received past(concat({3, 0, 5, 0, 0xE8, 3, 0, 0}, kEnd));
    b = past.pb->item_buffer;
    std::string tail = printed(
        "*  0:%p -- value type 5 --bytes (%p, 0 pad bytes, size: 1000)\n"
        ">> item pointer exceeds end of buffer. <<\n",
        b, b + 8);
    std::string text = dump(past.pb.get());
    EXPECT_EQ(text.substr(text.size() - std::min(text.size(), tail.size())), tail);
}

TEST(PackbuffDeathTest, PackingWithoutDataIsAProgrammingError) {
    std::function<void(sb_packbuff*)> packs[] = {
        [](sb_packbuff* pb) { sb_packbuff_pack_bytes(pb, 1, nullptr, 4); },
        [](sb_packbuff* pb) { sb_packbuff_pack_string(pb, 1, nullptr, 0); },
        [](sb_packbuff* pb) { sb_packbuff_pack_key_with_string_value(pb, 1, "k", 2, nullptr); },
    };
    for (auto& pack : packs) {
        Packbuff pb(sb_packbuff_new(0));
        EXPECT_DEATH(pack(pb.get()), "additional_bytes != NULL");
    }
}

}  // namespace

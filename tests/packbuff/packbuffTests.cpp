#include "src/packbuff/packbuff.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <memory>
#include <string>
#include <string_view>
#include <sys/mman.h>
#include <unistd.h>
#include <vector>

extern "C" int packbuff_round_trip_from_c(void);

namespace {

using Bytes = std::vector<uint8_t>;

// Raw wire bytes, for expected layouts and for buffers no writer would produce.
struct Wire {
    Bytes bytes;

    Wire& header(uint16_t itemType, uint16_t valueType, uint32_t value) {
        size_t at = bytes.size();
        bytes.resize(at + 8);
        memcpy(&bytes[at], &itemType, 2);
        memcpy(&bytes[at + 2], &valueType, 2);
        memcpy(&bytes[at + 4], &value, 4);
        return *this;
    }
    Wire& raw(std::string_view data) {
        bytes.insert(bytes.end(), data.begin(), data.end());
        return *this;
    }
    Wire& zeros(size_t count) {
        bytes.insert(bytes.end(), count, 0);
        return *this;
    }
    Wire& end() { return zeros(8); }
};

Bytes contents(const sb_packbuff* pb) {
    auto* start = static_cast<const uint8_t*>(sb_packbuff_get_bytes(pb));
    return Bytes(start, start + sb_packbuff_get_size(pb));
}

// A reader over exactly `data`, as a peer would hand it over (an empty buffer still has an address).
struct Reader {
    explicit Reader(const Bytes& data) : size(data.size()), memory(new uint8_t[data.size()]) {
        std::copy(data.begin(), data.end(), memory.get());
        pb = sb_packbuff_init_with_buffer(memory.get(), size, true, SB_PACKBUFF_DEALLOC_NONE);
    }
    ~Reader() { sb_packbuff_free(pb); }
    size_t cursor() const { return static_cast<size_t>(pb->item - pb->item_buffer); }

    size_t size;
    std::unique_ptr<uint8_t[]> memory;
    sb_packbuff* pb;
};

// Wraps `memory` for writing: no content yet, never grown or freed by the buffer.
sb_packbuff* wrap(Bytes& memory) {
    return sb_packbuff_init_with_buffer(memory.data(), memory.size(), false, SB_PACKBUFF_DEALLOC_NONE);
}

// Written into memory full of 0xAA so that padding which is not zeroed shows.
TEST(Packbuff, ItemsArePaddedToEightBytesWithZeros) {
    for (size_t length = 0; length <= 17; ++length) {
        SCOPED_TRACE(length);
        Bytes memory(64, 0xAA);
        sb_packbuff* pb = wrap(memory);
        std::string data(length, 'x');
        ASSERT_EQ(sb_packbuff_pack_bytes(pb, 9, data.data(), length), 0);
        size_t padded = (length + 7) / 8 * 8;
        Wire expected = Wire().header(3, 9, uint32_t(length)).raw(data).zeros(padded - length).end();
        EXPECT_EQ(contents(pb), expected.bytes);
        EXPECT_EQ(sb_packbuff_get_size(pb), 8 + padded + 8);
        sb_packbuff_free(pb);
    }
}

TEST(Packbuff, KeyValuePairs) {
    sb_packbuff* pb = sb_packbuff_new(0);
    ASSERT_EQ(sb_packbuff_pack_key_with_string_value(pb, 3, "group.a", 4, "/g/a"), 0);
    Bytes expected = Wire()
                         .header(2, 3, 8)
                         .raw(std::string_view("group.a\0", 8))
                         .header(2, 4, 5)
                         .raw(std::string_view("/g/a\0", 5))
                         .zeros(3)
                         .end()
                         .bytes;
    EXPECT_EQ(contents(pb), expected);

    Reader reader(contents(pb));
    const char* key = nullptr;
    const char* value = nullptr;
    uint16_t valueType = 0;
    size_t valueLength = 0;
    ASSERT_EQ(sb_packbuff_unpack_key_with_string_value(reader.pb, &key, &valueType, &value, &valueLength), 0);
    EXPECT_STREQ(key, "group.a");
    EXPECT_EQ(valueType, 4); // the value's tag, not the key's
    EXPECT_STREQ(value, "/g/a");
    EXPECT_EQ(valueLength, 4u);
    EXPECT_EQ(reader.cursor(), 32u);
    sb_packbuff_free(pb);

    // Room for the key item and its end marker, not for the value.
    Bytes memory(8 + 8 + 8, 0xAA);
    pb = wrap(memory);
    EXPECT_EQ(sb_packbuff_pack_key_with_string_value(pb, 3, "key", 4, "value"), ENOTSUP);
    EXPECT_EQ(contents(pb), Wire().header(2, 3, 4).raw(std::string_view("key\0", 4)).zeros(4).end().bytes);
    sb_packbuff_free(pb);

    // A pair cut off after the key reads as a failure of the whole pair.
    Reader cut(Wire().header(2, 3, 4).raw(std::string_view("key\0", 4)).zeros(4).end().bytes);
    key = "untouched";
    EXPECT_EQ(sb_packbuff_unpack_key_with_string_value(cut.pb, &key, nullptr, nullptr, nullptr), EINVAL);
    EXPECT_STREQ(key, "untouched");
    EXPECT_EQ(cut.cursor(), 0u);
}

// Every reallocation may move the memory; what was packed must come along unchanged.
TEST(Packbuff, GrowingKeepsEverything) {
    // A block size below 8 could not even hold the end marker; a uint32 is its header alone.
    sb_packbuff* tiny = sb_packbuff_new(7);
    ASSERT_EQ(sb_packbuff_pack_uint32(tiny, 1, 5), 0);
    EXPECT_EQ(contents(tiny), Wire().header(1, 1, 5).end().bytes);
    sb_packbuff_free(tiny);
    sb_packbuff* pb = sb_packbuff_new(64);
    Bytes flatMemory(64 * 1024);
    sb_packbuff* flat = wrap(flatMemory);
    // An item larger than a block, then many small ones.
    std::string big(200, 'b');
    ASSERT_EQ(sb_packbuff_pack_bytes(pb, 7, big.data(), big.size()), 0);
    ASSERT_EQ(sb_packbuff_pack_bytes(flat, 7, big.data(), big.size()), 0);
    for (uint32_t i = 0; i < 1000; ++i) {
        std::string text = "item-" + std::to_string(i);
        for (sb_packbuff* each : {pb, flat}) {
            ASSERT_EQ(sb_packbuff_pack_string(each, uint16_t(i), text.c_str(), text.size()), 0);
            ASSERT_EQ(sb_packbuff_pack_uint32(each, uint16_t(i), i * 3), 0);
        }
        ASSERT_EQ(pb->bytes_remaining, pb->bytes_allocated - pb->bytes_used);
    }
    EXPECT_EQ(contents(pb), contents(flat));
    // The grown memory can be taken with everything in it; wrapped memory cannot be.
    Bytes packed = contents(pb);
    auto* taken = static_cast<uint8_t*>(sb_packbuff_take_bytes(pb));
    ASSERT_NE(taken, nullptr);
    EXPECT_EQ(Bytes(taken, taken + packed.size()), packed);
    EXPECT_EQ(sb_packbuff_get_size(pb), 0u);
    free(taken);
    EXPECT_EQ(sb_packbuff_take_bytes(flat), nullptr);
    sb_packbuff_free(pb);
    sb_packbuff_free(flat);
}

// A refused item leaves what was packed as it was.
TEST(Packbuff, RefusesWhatWrappedMemoryOrTheFormatCannotHold) {
    for (uint32_t dealloc : {SB_PACKBUFF_DEALLOC_NONE, SB_PACKBUFF_DEALLOC_FREE}) {
        SCOPED_TRACE(dealloc);
        auto* memory = static_cast<uint8_t*>(malloc(32));
        sb_packbuff* pb = sb_packbuff_init_with_buffer(memory, 32, false, dealloc);
        ASSERT_EQ(sb_packbuff_pack_uint32(pb, 1, 1), 0);
        ASSERT_EQ(sb_packbuff_pack_uint32(pb, 2, 2), 0);
        ASSERT_EQ(sb_packbuff_pack_uint32(pb, 3, 3), 0); // exactly full, end marker included
        Bytes before = contents(pb);
        EXPECT_EQ(sb_packbuff_pack_uint32(pb, 4, 4), ENOTSUP);
        EXPECT_EQ(sb_packbuff_pack_string(pb, 4, "", 0), ENOTSUP);
        EXPECT_EQ(contents(pb), before);
        EXPECT_EQ(pb->bytes_allocated, 32u);
        sb_packbuff_free(pb);
        if (dealloc == SB_PACKBUFF_DEALLOC_NONE)
            free(memory);
    }
    uint8_t small[7];
    EXPECT_EQ(sb_packbuff_init_with_buffer(small, sizeof small, false, SB_PACKBUFF_DEALLOC_NONE), nullptr);
    EXPECT_EQ(sb_packbuff_init_with_buffer(small, sizeof small, true, 3), nullptr);
    EXPECT_EQ(sb_packbuff_init_with_buffer(nullptr, 64, true, SB_PACKBUFF_DEALLOC_NONE), nullptr);

    sb_packbuff* pb = sb_packbuff_new(0);
    ASSERT_EQ(sb_packbuff_pack_uint32(pb, 1, 1), 0);
    Bytes before = contents(pb);
    const char text[] = "abcd";
    // None of these reads the data: the checks come first.
    EXPECT_EQ(sb_packbuff_pack_string(pb, 1, text, 0xFFFFFFFFu), EINVAL);
    EXPECT_EQ(sb_packbuff_pack_string(pb, 1, text, 2), EINVAL); // no NUL at text[2]
    EXPECT_EQ(sb_packbuff_pack_string(pb, 1, nullptr, 0), EINVAL);
    EXPECT_EQ(sb_packbuff_pack_key_with_string_value(pb, 1, nullptr, 2, "v"), EINVAL);
    EXPECT_EQ(sb_packbuff_pack_bytes(pb, 1, text, size_t{0x100000000}), EINVAL);
    for (size_t length : {0xFFFFFFFFu, 0xFFFFFFF9u, 0xFFFFFFF8u, 0xFFFFFFF1u}) // with padding, over the limit
        EXPECT_EQ(sb_packbuff_pack_bytes(pb, 1, text, length), ERANGE) << length;
    EXPECT_EQ(contents(pb), before);
    EXPECT_EQ(pb->item, pb->item_buffer + 8);
    sb_packbuff_free(pb);
}

// The plain round trip is in the C file; here what it leaves out.
TEST(Packbuff, ReadsEveryKindAndSkips) {
    sb_packbuff* pb = sb_packbuff_new(0);
    ASSERT_EQ(sb_packbuff_pack_uint32(pb, 10, 42), 0);
    ASSERT_EQ(sb_packbuff_pack_string(pb, 11, "", 0), 0);
    ASSERT_EQ(sb_packbuff_pack_bytes(pb, 12, "\0\1\2", 3), 0);
    ASSERT_EQ(sb_packbuff_pack_string(pb, 13, "skipped", 7), 0);
    ASSERT_EQ(sb_packbuff_pack_uint32(pb, 14, 7), 0);
    Reader reader(contents(pb));
    sb_packbuff_free(pb);
    sb_packbuff* in = reader.pb;
    int error = -1;
    size_t length = 99;

    // The wrong kind leaves the cursor for a second try.
    EXPECT_EQ(sb_packbuff_unpack_string(in, &length, &error), nullptr);
    EXPECT_EQ(error, EINVAL);
    EXPECT_EQ(sb_packbuff_unpack_uint32(in, &error), 42u);
    EXPECT_EQ(error, 0);
    EXPECT_STREQ(sb_packbuff_unpack_string(in, &length, &error), "");
    EXPECT_EQ(length, 0u);
    // Points into the buffer, not at a copy.
    EXPECT_EQ(sb_packbuff_unpack_bytes(in, &length, &error), reader.memory.get() + 24 + 8);
    EXPECT_EQ(length, 3u);

    EXPECT_EQ(sb_packbuff_skip_item(in), 0);
    EXPECT_EQ(sb_packbuff_skip_item(in), 0);
    EXPECT_EQ(reader.cursor(), reader.size - 8);
    EXPECT_EQ(sb_packbuff_skip_item(in), EINVAL); // the end marker is not an item
    EXPECT_EQ(sb_packbuff_unpack_uint32(in, &error), 0u);
    EXPECT_EQ(error, EINVAL);
}

// A peer's first item, read as `kind`, then skipped: only a skip that succeeds moves the cursor.
TEST(Packbuff, RefusesBrokenItems) {
    struct Case {
        std::string name;
        Bytes bytes;
        uint16_t kind;
        int unpackError;
        int skipError;
    };
    std::vector<Case> cases = {
        // Skipping does not judge the contents of a string.
        {"string without a NUL", Wire().header(2, 0, 3).raw("abc").zeros(5).end().bytes, 2, EINVAL, 0},
        {"NUL not last", Wire().header(2, 0, 3).raw(std::string_view("a\0c", 3)).zeros(5).end().bytes, 2, EINVAL, 0},
        {"string of length 0", Wire().header(2, 0, 0).end().bytes, 2, EINVAL, 0},
        {"string with no end marker behind it", Wire().header(2, 5, 4).raw(std::string_view("tmp\0", 4)).zeros(4).bytes,
         2, ERANGE, ERANGE},
        {"value with no end marker behind it", Wire().header(1, 5, 4).bytes, 1, ERANGE, ERANGE},
        {"unknown item type", Wire().header(9, 8, 0).end().bytes, 1, EINVAL, EINVAL},
    };
    // Lengths that point past the end, including ones whose padding wraps in 32 bits.
    for (uint32_t lie : {17u, 0x7FFFFFFFu, 0xFFFFFFF9u, 0xFFFFFFFFu})
        cases.push_back({"bytes of length " + std::to_string(lie), Wire().header(3, 5, lie).raw("12345678").end().bytes,
                         3, ERANGE, ERANGE});
    // Too short for a header: fewer than 4 bytes read as the end; 4 to 7 show a tag.
    Bytes header = Wire().header(1, 6, 1).bytes;
    for (long size = 0; size < 8; ++size)
        cases.push_back({"buffer of " + std::to_string(size) + " bytes", Bytes(header.begin(), header.begin() + size),
                         1, ERANGE, ERANGE});

    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        Reader reader(c.bytes);
        EXPECT_EQ(sb_packbuff_get_item_value_type(reader.pb, nullptr), c.bytes.size() >= 4);
        int error = -1;
        size_t length = 99;
        if (c.kind == SB_PACKBUFF_ITEM_UINT32)
            EXPECT_EQ(sb_packbuff_unpack_uint32(reader.pb, &error), 0u);
        else if (c.kind == SB_PACKBUFF_ITEM_STRING)
            EXPECT_EQ(sb_packbuff_unpack_string(reader.pb, &length, &error), nullptr);
        else
            EXPECT_EQ(sb_packbuff_unpack_bytes(reader.pb, &length, &error), nullptr);
        EXPECT_EQ(error, c.unpackError);
        EXPECT_EQ(length, c.kind == SB_PACKBUFF_ITEM_UINT32 ? 99u : 0u);
        EXPECT_EQ(reader.cursor(), 0u);
        EXPECT_EQ(sb_packbuff_skip_item(reader.pb), c.skipError);
        EXPECT_EQ(reader.cursor(), c.skipError ? 0 : c.bytes.size() - 8);
    }
}

std::string format(const char* fmt, auto... args) {
    char line[512];
    snprintf(line, sizeof line, fmt, args...);
    return line;
}

// The dump runs on buffers from the kernel: it stops at the end of the used bytes whatever items claim.
TEST(Packbuff, DumpStopsAtTheEndOfTheUsedBytes) {
    struct Case {
        Bytes memory;
        size_t used;
        const char* tail; // ends the dump, with the address `at` bytes into the memory
        size_t at;
    } cases[] = {
        // A string whose length runs past the used bytes, and that has no NUL inside them.
        {Wire().header(1, 0, 7).header(2, 1, 40).raw("abcdefgh").bytes, 24,
         "string (%p, 0 pad bytes, size: 40): \n     `abcdefgh'\n", 16},
        // The used bytes end right after an item: whatever lies behind them is not shown.
        {Wire().header(1, 0, 7).header(1, 0, 9).end().bytes, 8, "*  0:%p -- value type 0 --inline value: 7\n", 0},
        // An item type the dump does not know still advances by its header.
        {Wire().header(6, 3, 0).header(6, 4, 0).bytes, 16, "   1:%p -- value type 4 --*Unknown item type* 6\n", 8},
    };
    for (Case& c : cases) {
        sb_packbuff* pb = sb_packbuff_init_with_buffer(c.memory.data(), c.memory.size(), true,
                                                       SB_PACKBUFF_DEALLOC_NONE);
        sb_packbuff_set_size(pb, c.used);
        std::string tail = format(c.tail, static_cast<const void*>(c.memory.data() + c.at)) +
                           ">> item pointer exceeds end of buffer. <<\n";
        testing::internal::CaptureStdout();
        int count = sb_packbuff_print(pb);
        std::string dump = testing::internal::GetCapturedStdout();
        EXPECT_EQ(count, static_cast<int>(dump.size()));
        ASSERT_GE(dump.size(), tail.size()) << dump;
        EXPECT_EQ(dump.substr(dump.size() - tail.size()), tail);
        sb_packbuff_free(pb);
    }
}

TEST(Packbuff, FreeReleasesMappedMemory) {
    size_t page = static_cast<size_t>(sysconf(_SC_PAGESIZE));
    void* region = mmap(nullptr, page, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    ASSERT_NE(region, MAP_FAILED);
    sb_packbuff* pb = sb_packbuff_init_with_buffer(region, page, false, SB_PACKBUFF_DEALLOC_VM_DEALLOCATE);
    ASSERT_EQ(sb_packbuff_pack_uint32(pb, 0, 1), 0);
    sb_packbuff_free(pb);
    unsigned char resident;
    EXPECT_EQ(mincore(region, page, &resident), -1);
    EXPECT_EQ(errno, ENOMEM); // nothing mapped there any more
}

TEST(PackbuffDeathTest, BrokenCallsStopTheProcess) {
    sb_packbuff* pb = sb_packbuff_new(0);
    EXPECT_DEATH(sb_packbuff_pack_bytes(pb, 1, nullptr, 4), "additional_bytes != NULL");
    EXPECT_DEATH(sb_packbuff_set_size(pb, pb->bytes_allocated + 1), "size <= pb->bytes_allocated");
    sb_packbuff_free(pb);
}

TEST(Packbuff, UsableFromC) {
    EXPECT_EQ(packbuff_round_trip_from_c(), 0) << "first failing line in the C file";
}

} // namespace

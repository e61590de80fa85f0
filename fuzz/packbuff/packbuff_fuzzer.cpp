// Walks any input as the kernel's upcall request buffer would be walked, and writes what
// it could read into a fresh buffer that must read back the same. The input is copied to
// memory of exactly its size so that any read past it is caught.
#include "src/packbuff/packbuff.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

namespace {

struct Item {
    int kind; // 1 uint32, 2 string, 3 bytes
    uint16_t tag;
    uint32_t value;
    std::string data;
};

void require(bool condition, const char* what) {
    if (!condition) {
        fprintf(stderr, "packbuff fuzzer: %s\n", what);
        abort();
    }
}

bool inside(const void* data, size_t length, const uint8_t* start, size_t size) {
    auto* p = static_cast<const uint8_t*>(data);
    return p >= start && length <= size && static_cast<size_t>(p - start) <= size - length;
}

// Reads items until the end marker or an item that can be neither read nor skipped.
std::vector<Item> walk(sb_packbuff* pb, const uint8_t* start, size_t size) {
    std::vector<Item> items;
    uint16_t tag;
    while (sb_packbuff_get_item_value_type(pb, &tag)) {
        const uint8_t* before = pb->item;
        int error = 0;
        size_t length = 0;
        switch (tag) {
        case 0:
        case 1:
        case 2:
        case 4:
        case 6:
        case 7: {
            const char* string = sb_packbuff_unpack_string(pb, &length, &error);
            if (error == 0) {
                require(inside(string, length + 1, start, size), "string outside the buffer");
                require(string[length] == '\0', "string without its NUL");
                // Kept up to the first NUL, which is what a writer can pack again.
                items.push_back({2, tag, 0, std::string(string)});
            }
            break;
        }
        case 3:
        case 5:
        case 8: {
            uint32_t value = sb_packbuff_unpack_uint32(pb, &error);
            if (error == 0)
                items.push_back({1, tag, value, {}});
            break;
        }
        default:
            if (tag % 2 == 0) {
                const void* data = sb_packbuff_unpack_bytes(pb, &length, &error);
                if (error == 0) {
                    require(inside(data, length, start, size), "bytes outside the buffer");
                    items.push_back({3, tag, 0, std::string(static_cast<const char*>(data), length)});
                }
            } else {
                const char* key;
                const char* value;
                uint16_t valueTag;
                size_t valueLength;
                error = sb_packbuff_unpack_key_with_string_value(pb, &key, &valueTag, &value, &valueLength);
                if (error == 0) {
                    require(inside(value, valueLength + 1, start, size), "value outside the buffer");
                    items.push_back({2, tag, 0, key});
                    items.push_back({2, valueTag, 0, std::string(value)});
                }
            }
            break;
        }
        if (error != 0) {
            require(pb->item == before, "a failed read moved the cursor");
            if (sb_packbuff_skip_item(pb) != 0) {
                require(pb->item == before, "a failed skip moved the cursor");
                break;
            }
        }
        require(pb->item > before && pb->item < start + size, "cursor left the buffer");
        require((pb->item - before) % SB_PACKBUFF_BYTE_ALIGNMENT == 0, "unaligned advance");
    }
    return items;
}

} // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    // The dump is exercised on every input; nobody needs to read it.
    if (!freopen("/dev/null", "w", stdout))
        abort();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::unique_ptr<uint8_t[]> memory(new uint8_t[size]);
    memcpy(memory.get(), data, size);
    sb_packbuff* in = sb_packbuff_init_with_buffer(memory.get(), size, true, SB_PACKBUFF_DEALLOC_NONE);
    require(in != nullptr, "cannot wrap the input");
    sb_packbuff_print(in);
    std::vector<Item> items = walk(in, memory.get(), size);
    sb_packbuff_free(in);

    // Small blocks from the input itself, so that growth runs at every step.
    sb_packbuff* out = sb_packbuff_new(size > 0 ? data[0] : 0);
    require(out != nullptr, "cannot create a buffer");
    for (const Item& item : items) {
        int error = item.kind == 1 ? sb_packbuff_pack_uint32(out, item.tag, item.value)
                    : item.kind == 2
                        ? sb_packbuff_pack_string(out, item.tag, item.data.c_str(), item.data.size())
                        : sb_packbuff_pack_bytes(out, item.tag, item.data.data(), item.data.size());
        require(error == 0, "cannot pack an item that was read");
        require(out->bytes_remaining == out->bytes_allocated - out->bytes_used, "sizes disagree");
    }
    size_t used = sb_packbuff_get_size(out);
    std::unique_ptr<uint8_t[]> copy(new uint8_t[used]);
    memcpy(copy.get(), sb_packbuff_get_bytes(out), used);
    sb_packbuff_free(out);

    sb_packbuff* again = sb_packbuff_init_with_buffer(copy.get(), used, true, SB_PACKBUFF_DEALLOC_NONE);
    for (const Item& item : items) {
        uint16_t tag = 0;
        require(sb_packbuff_get_item_value_type(again, &tag) && tag == item.tag,
                "item missing on reading back");
        int error = 0;
        size_t length = 0;
        if (item.kind == 1) {
            require(sb_packbuff_unpack_uint32(again, &error) == item.value && error == 0, "value changed");
        } else if (item.kind == 2) {
            const char* string = sb_packbuff_unpack_string(again, &length, &error);
            require(error == 0 && std::string(string, length) == item.data, "string changed");
        } else {
            const void* bytes = sb_packbuff_unpack_bytes(again, &length, &error);
            require(error == 0 && length == item.data.size() && memcmp(bytes, item.data.data(), length) == 0,
                    "bytes changed");
        }
    }
    require(!sb_packbuff_get_item_value_type(again, nullptr), "end marker missing");
    sb_packbuff_free(again);
    return 0;
}

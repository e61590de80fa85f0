#include "src/packbuff/packbuff.h"

#include "common/STWLog.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <sys/mman.h>

namespace {

constexpr size_t BYTE_ALIGNMENT = SB_PACKBUFF_BYTE_ALIGNMENT;
constexpr size_t HEADER_SIZE = 8;
constexpr size_t DEFAULT_BLOCK_SIZE = 256;
// Largest padded data length an item may carry; keeps length + header inside 32 bits.
constexpr uint32_t PADDED_LENGTH_LIMIT = 0xFFFFFFF8u;

// Broken internal state is a bug in the caller or in this file, never bad input: stop.
#define PACKBUFF_ASSERT(condition)                                                                           \
    do {                                                                                                     \
        if (!(condition))                                                                                    \
            _assertion_failed(__func__, #condition);                                                         \
    } while (0)

[[noreturn]] void _assertion_failed(const char* function, const char* condition) {
    STWLog::fatal(function, STWFormat("%s: assertion failed: %s", function, condition));
}

struct ItemHeader {
    uint16_t item_type;
    uint16_t value_type;
    uint32_t value; // the inline value or the data length
};

// Headers go through memcpy: wrapped memory from a peer need not be aligned.
ItemHeader _read_header(const uint8_t* at) {
    ItemHeader header;
    memcpy(&header.item_type, at, 2);
    memcpy(&header.value_type, at + 2, 2);
    memcpy(&header.value, at + 4, 4);
    return header;
}

void _write_header(uint8_t* at, uint16_t item_type, uint16_t value_type, uint32_t value) {
    memcpy(at, &item_type, 2);
    memcpy(at + 2, &value_type, 2);
    memcpy(at + 4, &value, 4);
}

void _write_end_marker(uint8_t* at) {
    memset(at, 0, HEADER_SIZE);
}

uint32_t _padding(uint32_t length) {
    return static_cast<uint32_t>((BYTE_ALIGNMENT - length % BYTE_ALIGNMENT) % BYTE_ALIGNMENT);
}

// The cursor as an offset into the memory, when it lies inside it. Compared as integers:
// the fields are public and a cursor may point anywhere.
bool _cursor_offset(const sb_packbuff* pb, size_t* offset) {
    uintptr_t start = reinterpret_cast<uintptr_t>(pb->item_buffer);
    uintptr_t cursor = reinterpret_cast<uintptr_t>(pb->item);
    if (pb->item_buffer == nullptr || cursor < start || cursor - start >= pb->bytes_allocated)
        return false;
    *offset = cursor - start;
    return true;
}

void _advance(sb_packbuff* pb, size_t bytes_to_advance) {
    PACKBUFF_ASSERT((bytes_to_advance % BYTE_ALIGNMENT) == 0);
    pb->item += bytes_to_advance;
}

int _grow(sb_packbuff* pb, size_t extra) {
    if (pb->block_size == 0 || pb->dealloc_type != SB_PACKBUFF_DEALLOC_FREE)
        return ENOTSUP;
    size_t allocated;
    if (__builtin_add_overflow(pb->bytes_allocated, pb->block_size, &allocated))
        return ENOMEM;
    size_t needed;
    if (__builtin_add_overflow(extra, BYTE_ALIGNMENT - 1, &needed))
        return ENOMEM;
    needed &= ~(BYTE_ALIGNMENT - 1);
    if (needed > allocated - pb->bytes_used && __builtin_add_overflow(allocated, needed, &allocated))
        return ENOMEM;
    // Plain realloc rather than one that releases the old memory on failure: the items
    // packed so far must survive, a reply still goes out with its status after a failure.
    void* memory = realloc(pb->item_buffer, allocated);
    if (memory == nullptr)
        return ENOMEM;
    pb->item_buffer = static_cast<uint8_t*>(memory);
    pb->bytes_allocated = allocated;
    pb->bytes_remaining = allocated - pb->bytes_used;
    pb->item =
        pb->bytes_used >= HEADER_SIZE ? pb->item_buffer + pb->bytes_used - HEADER_SIZE : pb->item_buffer;
    return 0;
}

int sb_packbuff_pack_item(sb_packbuff* pb, uint16_t item_type, uint16_t value_type, uint32_t inline_value,
                          const void* additional_bytes, size_t length) {
    uint32_t extra_bytes_needed = 0;
    uint32_t padded_length = 0;
    switch (item_type) {
    case SB_PACKBUFF_ITEM_UINT32:
        // The value travels in the header; there is nothing to pad.
        extra_bytes_needed = _padding(static_cast<uint32_t>(length));
        PACKBUFF_ASSERT(extra_bytes_needed == 0);
        break;
    case SB_PACKBUFF_ITEM_STRING:
    case SB_PACKBUFF_ITEM_BYTES:
        PACKBUFF_ASSERT(additional_bytes != NULL);
        if (length > UINT32_MAX)
            return EINVAL;
        extra_bytes_needed = _padding(static_cast<uint32_t>(length));
        if (__builtin_add_overflow(static_cast<uint32_t>(length), extra_bytes_needed, &padded_length) ||
            padded_length >= PADDED_LENGTH_LIMIT)
            return ERANGE;
        break;
    default:
        return EINVAL;
    }

    size_t need = size_t{padded_length} + HEADER_SIZE;
    if (pb->bytes_remaining < need) {
        if (int error = _grow(pb, need))
            return error;
    }
    // The item and the end marker behind it must fit after the cursor. Only a caller that
    // moved the cursor or the size by hand can break this, but memory past the end is
    // never written.
    size_t offset;
    if (!_cursor_offset(pb, &offset) || pb->bytes_allocated - offset < need + HEADER_SIZE)
        return ERANGE;

    uint8_t* at = pb->item;
    if (item_type == SB_PACKBUFF_ITEM_UINT32) {
        _write_header(at, item_type, value_type, inline_value);
    } else {
        _write_header(at, item_type, value_type, static_cast<uint32_t>(length));
        memcpy(at + HEADER_SIZE, additional_bytes, length);
        memset(at + HEADER_SIZE + length, 0, extra_bytes_needed);
    }
    pb->bytes_used += need;
    pb->bytes_remaining -= need;
    _advance(pb, need);
    _write_end_marker(pb->item);
    return 0;
}

// Reads the item at the cursor if it has the expected type and moves past it. Every
// length is checked against the memory before anything behind the header is touched.
int sb_packbuff_unpack_item(sb_packbuff* pb, uint16_t expected_type, uint32_t* value, const uint8_t** data,
                            uint32_t* length) {
    size_t offset;
    if (!_cursor_offset(pb, &offset) || pb->bytes_allocated - offset < HEADER_SIZE)
        return ERANGE;
    ItemHeader header = _read_header(pb->item);
    if (header.item_type != expected_type)
        return EINVAL;

    // 64 bits: a 32-bit length plus header and padding cannot overflow.
    uint64_t bytes_to_advance = HEADER_SIZE;
    if (expected_type == SB_PACKBUFF_ITEM_STRING || expected_type == SB_PACKBUFF_ITEM_BYTES)
        bytes_to_advance += uint64_t{header.value} + _padding(header.value);
    // The next cursor must still lie inside the memory, so a last item without at least
    // part of an end marker behind it is refused.
    if (bytes_to_advance >= pb->bytes_allocated - offset)
        return ERANGE;

    if (expected_type == SB_PACKBUFF_ITEM_UINT32) {
        *value = header.value;
    } else {
        *data = pb->item + HEADER_SIZE;
        *length = header.value;
    }
    _advance(pb, static_cast<size_t>(bytes_to_advance));
    return 0;
}

int _unpack_string(sb_packbuff* pb, const char** string, size_t* length) {
    uint8_t* start = pb->item;
    const uint8_t* data = nullptr;
    uint32_t data_length = 0;
    if (int error = sb_packbuff_unpack_item(pb, SB_PACKBUFF_ITEM_STRING, nullptr, &data, &data_length))
        return error;
    if (data_length == 0 || data[data_length - 1] != '\0') {
        pb->item = start;
        return EINVAL;
    }
    *string = reinterpret_cast<const char*>(data);
    *length = data_length - 1;
    return 0;
}

sb_packbuff* _new_wrapper(void* memory, size_t size, bool has_content, uint32_t dealloc_type) {
    if (memory == nullptr || dealloc_type > SB_PACKBUFF_DEALLOC_VM_DEALLOCATE)
        return nullptr;
    if (!has_content && size < HEADER_SIZE)
        return nullptr;
    auto* pb = static_cast<sb_packbuff*>(calloc(1, sizeof(sb_packbuff)));
    if (pb == nullptr)
        return nullptr;
    pb->dealloc_type = dealloc_type;
    pb->block_size = 0;
    pb->bytes_allocated = size;
    pb->item_buffer = static_cast<uint8_t*>(memory);
    pb->item = pb->item_buffer;
    if (has_content) {
        pb->bytes_used = size;
    } else {
        _write_end_marker(pb->item_buffer);
        pb->bytes_used = HEADER_SIZE;
    }
    pb->bytes_remaining = size - pb->bytes_used;
    return pb;
}

const char* _dealloc_type_name(uint32_t dealloc_type) {
    switch (dealloc_type) {
    case SB_PACKBUFF_DEALLOC_NONE:
        return "None";
    case SB_PACKBUFF_DEALLOC_FREE:
        return "free()";
    case SB_PACKBUFF_DEALLOC_VM_DEALLOCATE:
        return "vm_deallocate()";
    default:
        return "<Unknown>";
    }
}

} // namespace

extern "C" {

sb_packbuff* sb_packbuff_new_with_tag(size_t block_size) {
    if (block_size < HEADER_SIZE)
        block_size = DEFAULT_BLOCK_SIZE;
    auto* pb = static_cast<sb_packbuff*>(calloc(1, sizeof(sb_packbuff)));
    if (pb == nullptr)
        return nullptr;
    pb->item_buffer = static_cast<uint8_t*>(malloc(block_size));
    if (pb->item_buffer == nullptr) {
        free(pb);
        return nullptr;
    }
    pb->dealloc_type = SB_PACKBUFF_DEALLOC_FREE;
    pb->block_size = block_size;
    pb->bytes_allocated = block_size;
    pb->bytes_used = HEADER_SIZE;
    pb->bytes_remaining = block_size - HEADER_SIZE;
    pb->item = pb->item_buffer;
    _write_end_marker(pb->item);
    return pb;
}

sb_packbuff* sb_packbuff_new(size_t block_size) {
    return sb_packbuff_new_with_tag(block_size);
}

sb_packbuff* sb_packbuff_init_with_buffer(void* memory, size_t size, bool has_content,
                                          uint32_t dealloc_type) {
    return _new_wrapper(memory, size, has_content, dealloc_type);
}

sb_packbuff* sb_packbuff_init_with_buffer_and_tag(void* memory, size_t size, bool has_content,
                                                  uint32_t dealloc_type) {
    return _new_wrapper(memory, size, has_content, dealloc_type);
}

void sb_packbuff_free(sb_packbuff* pb) {
    if (pb == nullptr)
        return;
    switch (pb->dealloc_type) {
    case SB_PACKBUFF_DEALLOC_VM_DEALLOCATE:
        if (munmap(pb->item_buffer, pb->bytes_allocated) != 0)
            STW_LOG_ERROR(STWLogCategory::Upcall, "failed: vm_deallocate(%p, %zu)",
                          static_cast<const void*>(pb->item_buffer), pb->bytes_allocated);
        break;
    case SB_PACKBUFF_DEALLOC_FREE:
        free(pb->item_buffer);
        break;
    default:
        break;
    }
    free(pb);
}

void* sb_packbuff_get_bytes(const sb_packbuff* pb) {
    return pb->item_buffer;
}

void* sb_packbuff_take_bytes(sb_packbuff* pb) {
    if (pb->dealloc_type != SB_PACKBUFF_DEALLOC_FREE)
        return nullptr;
    void* bytes = pb->item_buffer;
    pb->dealloc_type = SB_PACKBUFF_DEALLOC_NONE;
    pb->block_size = 0;
    pb->bytes_allocated = pb->bytes_remaining = pb->bytes_used = 0;
    pb->item_buffer = pb->item = nullptr;
    return bytes;
}

size_t sb_packbuff_get_size(const sb_packbuff* pb) {
    return pb->bytes_used;
}

void sb_packbuff_set_size(sb_packbuff* pb, size_t size) {
    // A size past the memory would make bytes_remaining wrap and let writers run off the end.
    PACKBUFF_ASSERT(size <= pb->bytes_allocated);
    pb->bytes_used = size;
    pb->bytes_remaining = pb->bytes_allocated - size;
}

int sb_packbuff_pack_uint32(sb_packbuff* pb, uint16_t value_type, uint32_t value) {
    return sb_packbuff_pack_item(pb, SB_PACKBUFF_ITEM_UINT32, value_type, value, nullptr, 0);
}

int sb_packbuff_pack_string(sb_packbuff* pb, uint16_t value_type, const char* string, size_t length) {
    if (string == nullptr || length > 0xFFFFFFFEu || string[length] != '\0')
        return EINVAL;
    return sb_packbuff_pack_item(pb, SB_PACKBUFF_ITEM_STRING, value_type, 0, string, length + 1);
}

int sb_packbuff_pack_bytes(sb_packbuff* pb, uint16_t value_type, const void* data, size_t length) {
    if (length > 0xFFFFFFFFu)
        return EINVAL;
    return sb_packbuff_pack_item(pb, SB_PACKBUFF_ITEM_BYTES, value_type, 0, data, length);
}

int sb_packbuff_pack_key_with_string_value(sb_packbuff* pb, uint16_t key_value_type, const char* key,
                                           uint16_t value_value_type, const char* value) {
    if (key == nullptr || value == nullptr)
        return EINVAL;
    if (int error = sb_packbuff_pack_string(pb, key_value_type, key, strlen(key)))
        return error;
    return sb_packbuff_pack_string(pb, value_value_type, value, strlen(value));
}

bool sb_packbuff_get_item_value_type(const sb_packbuff* pb, uint16_t* value_type) {
    size_t offset;
    if (!_cursor_offset(pb, &offset) || pb->bytes_allocated - offset < 4)
        return false;
    uint16_t item_type;
    memcpy(&item_type, pb->item, 2);
    if (item_type == SB_PACKBUFF_ITEM_END)
        return false;
    if (value_type != nullptr)
        memcpy(value_type, pb->item + 2, 2);
    return true;
}

int sb_packbuff_skip_item(sb_packbuff* pb) {
    size_t offset;
    if (!_cursor_offset(pb, &offset) || pb->bytes_allocated - offset < HEADER_SIZE)
        return ERANGE;
    uint16_t item_type = _read_header(pb->item).item_type;
    uint32_t value;
    const uint8_t* data;
    uint32_t length;
    switch (item_type) {
    case SB_PACKBUFF_ITEM_UINT32:
    case SB_PACKBUFF_ITEM_STRING:
    case SB_PACKBUFF_ITEM_BYTES:
        return sb_packbuff_unpack_item(pb, item_type, &value, &data, &length);
    default:
        return EINVAL;
    }
}

uint32_t sb_packbuff_unpack_uint32(sb_packbuff* pb, int* error) {
    uint32_t value = 0;
    int result = sb_packbuff_unpack_item(pb, SB_PACKBUFF_ITEM_UINT32, &value, nullptr, nullptr);
    if (error != nullptr)
        *error = result;
    return result == 0 ? value : 0;
}

const char* sb_packbuff_unpack_string(sb_packbuff* pb, size_t* length, int* error) {
    const char* string = nullptr;
    size_t string_length = 0;
    int result = _unpack_string(pb, &string, &string_length);
    if (length != nullptr)
        *length = string_length;
    if (error != nullptr)
        *error = result;
    return string;
}

const void* sb_packbuff_unpack_bytes(sb_packbuff* pb, size_t* length, int* error) {
    const uint8_t* data = nullptr;
    uint32_t data_length = 0;
    int result = sb_packbuff_unpack_item(pb, SB_PACKBUFF_ITEM_BYTES, nullptr, &data, &data_length);
    if (length != nullptr)
        *length = result == 0 ? data_length : 0;
    if (error != nullptr)
        *error = result;
    return result == 0 ? data : nullptr;
}

int sb_packbuff_unpack_key_with_string_value(sb_packbuff* pb, const char** key, uint16_t* value_type,
                                             const char** value, size_t* value_length) {
    uint8_t* start = pb->item;
    const char* key_string;
    size_t key_length;
    if (int error = _unpack_string(pb, &key_string, &key_length))
        return error;
    uint16_t value_tag = 0;
    sb_packbuff_get_item_value_type(pb, &value_tag);
    const char* value_string;
    size_t value_string_length;
    if (int error = _unpack_string(pb, &value_string, &value_string_length)) {
        pb->item = start;
        return error;
    }
    if (key != nullptr)
        *key = key_string;
    if (value_type != nullptr)
        *value_type = value_tag;
    if (value != nullptr)
        *value = value_string;
    if (value_length != nullptr)
        *value_length = value_string_length;
    return 0;
}

int sb_packbuff_print(const sb_packbuff* pb) {
    int count = 0;
    auto out = [&count](int printed) {
        if (printed > 0)
            count += printed;
    };
    out(printf("packbuff: %p\n", static_cast<const void*>(pb)));
    out(printf("  block_size:      %zu\n", pb->block_size));
    out(printf("  dealloc_type:    %s\n", _dealloc_type_name(pb->dealloc_type)));
    out(printf("  bytes_allocated: %zu\n", pb->bytes_allocated));
    out(printf("  bytes_used:      %zu\n", pb->bytes_used));
    out(printf("  bytes_remaining: %zu\n", pb->bytes_remaining));
    out(printf("  item_buffer %p, item: %p\n", static_cast<const void*>(pb->item_buffer),
               static_cast<const void*>(pb->item)));
    out(printf("\n"));
    if (pb->item_buffer == nullptr)
        return count;

    // Only the used bytes are walked, and a string is printed no further than they reach.
    const size_t limit = std::min(pb->bytes_used, pb->bytes_allocated);
    size_t offset = 0;
    for (int index = 0;; ++index) {
        if (limit < HEADER_SIZE || offset > limit - HEADER_SIZE) {
            out(printf(">> item pointer exceeds end of buffer. <<\n"));
            break;
        }
        const uint8_t* at = pb->item_buffer + offset;
        const char* marker = at == pb->item ? "*" : " ";
        ItemHeader header = _read_header(at);
        if (header.item_type == SB_PACKBUFF_ITEM_END) {
            out(printf("%s%3d: %p -- END\n", marker, index, static_cast<const void*>(at)));
            break;
        }
        out(printf("%s%3d:%p -- value type %u --", marker, index, static_cast<const void*>(at),
                   unsigned{header.value_type}));
        uint64_t bytes_to_advance = HEADER_SIZE;
        switch (header.item_type) {
        case SB_PACKBUFF_ITEM_UINT32:
            out(printf("inline value: %u\n", header.value));
            break;
        case SB_PACKBUFF_ITEM_STRING: {
            size_t shown = std::min<size_t>({header.value, limit - offset - HEADER_SIZE, INT_MAX});
            out(printf("string (%p, %u pad bytes, size: %u): \n     `%.*s'\n",
                       static_cast<const void*>(at + HEADER_SIZE), _padding(header.value), header.value,
                       static_cast<int>(shown), reinterpret_cast<const char*>(at + HEADER_SIZE)));
            bytes_to_advance += uint64_t{header.value} + _padding(header.value);
            break;
        }
        case SB_PACKBUFF_ITEM_BYTES:
            out(printf("bytes (%p, %u pad bytes, size: %u)\n", static_cast<const void*>(at + HEADER_SIZE),
                       _padding(header.value), header.value));
            bytes_to_advance += uint64_t{header.value} + _padding(header.value);
            break;
        default:
            out(printf("*Unknown item type* %u\n", unsigned{header.item_type}));
            break;
        }
        if (__builtin_add_overflow(offset, bytes_to_advance, &offset)) {
            out(printf(">> item pointer overflow. <<\n"));
            break;
        }
    }
    return count;
}

} // extern "C"

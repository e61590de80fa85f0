// The packed buffer: the flat list of typed items in which the kernel's sandbox and the
// upcall server exchange requests and replies.
//
// Byte format, in native byte order, every item starting at a multiple of 8 from the start:
//   16-bit item type (0 end, 1 inline 32-bit value, 2 string, 3 bytes)
//   16-bit value type (the tag the using protocol assigns)
//   32-bit inline value, or the data length of a string or bytes item
//   the data and zero padding to the next multiple of 8 (strings and bytes only)
// The list is closed by an 8-byte end marker, which a writer keeps behind the last item
// at all times and which bytes_used counts.
//
// The functions return errno values (0, ENOMEM, EINVAL, ERANGE, ENOTSUP). Readers hand out
// pointers into the buffer and never look outside it, so a buffer received from a peer may
// be walked whatever its bytes are. An object is not safe for concurrent use.
#pragma once

#include <stdbool.h>
#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#define SB_PACKBUFF_BYTE_ALIGNMENT 8

// Item types on the wire.
enum {
    SB_PACKBUFF_ITEM_END = 0,
    SB_PACKBUFF_ITEM_UINT32 = 1,
    SB_PACKBUFF_ITEM_STRING = 2,
    SB_PACKBUFF_ITEM_BYTES = 3,
};

// Who releases the memory (sb_packbuff.dealloc_type).
enum {
    SB_PACKBUFF_DEALLOC_NONE = 0,          // the caller owns it
    SB_PACKBUFF_DEALLOC_FREE = 1,          // heap memory, owned and growable
    SB_PACKBUFF_DEALLOC_VM_DEALLOCATE = 2, // an mmap()ed region, unmapped on release
};

typedef struct sb_packbuff {
    uint32_t dealloc_type; // one of SB_PACKBUFF_DEALLOC_*
    size_t block_size;     // growth step; 0 for wrapped memory, which never grows
    size_t bytes_allocated;
    size_t bytes_remaining; // bytes_allocated - bytes_used
    size_t bytes_used;      // end marker included
    uint8_t* item_buffer;
    uint8_t* item; // writing: where the end marker is; reading: the next item
} sb_packbuff;

// An owned heap buffer of one block holding only the end marker. A block size below 8
// becomes 256. NULL when memory runs out.
sb_packbuff* sb_packbuff_new_with_tag(size_t block_size);
sb_packbuff* sb_packbuff_new(size_t block_size);

// Wraps `memory` without copying. Without content an end marker is written at the start
// (`size` must be at least 8); with content the whole size counts as used, ready for
// reading. NULL for NULL memory, an unknown dealloc type or no room for the end marker.
sb_packbuff* sb_packbuff_init_with_buffer(void* memory, size_t size, bool has_content, uint32_t dealloc_type);
sb_packbuff* sb_packbuff_init_with_buffer_and_tag(void* memory, size_t size, bool has_content,
                                                  uint32_t dealloc_type);

// Releases the memory as its dealloc type says, then the object. NULL is ignored.
void sb_packbuff_free(sb_packbuff* pb);

void* sb_packbuff_get_bytes(const sb_packbuff* pb);
// Hands an owned heap buffer's memory (SB_PACKBUFF_DEALLOC_FREE) to the caller, who
// releases it with free(), so that a finished buffer is sent without a copy; the packed
// buffer is left empty, fit only for sb_packbuff_free(). NULL for wrapped or mapped memory.
void* sb_packbuff_take_bytes(sb_packbuff* pb);
size_t sb_packbuff_get_size(const sb_packbuff* pb);
// For memory filled by someone else: `size` must not exceed bytes_allocated.
void sb_packbuff_set_size(sb_packbuff* pb, size_t size);

int sb_packbuff_pack_uint32(sb_packbuff* pb, uint16_t value_type, uint32_t value);
// `length` counts the characters without the NUL, which must be at string[length].
int sb_packbuff_pack_string(sb_packbuff* pb, uint16_t value_type, const char* string, size_t length);
int sb_packbuff_pack_bytes(sb_packbuff* pb, uint16_t value_type, const void* data, size_t length);
// Two string items. When the value cannot be packed the key item stays written.
int sb_packbuff_pack_key_with_string_value(sb_packbuff* pb, uint16_t key_value_type, const char* key,
                                           uint16_t value_value_type, const char* value);

// False at the end marker or when fewer than 4 bytes are left; does not move the cursor.
bool sb_packbuff_get_item_value_type(const sb_packbuff* pb, uint16_t* value_type);
int sb_packbuff_skip_item(sb_packbuff* pb);
// The unpack functions store 0 or an errno value in *error (when not NULL) and return 0 or
// NULL on failure, leaving the cursor where it was. Strings and bytes point into the
// buffer; a string is NUL-terminated at string[*length].
uint32_t sb_packbuff_unpack_uint32(sb_packbuff* pb, int* error);
const char* sb_packbuff_unpack_string(sb_packbuff* pb, size_t* length, int* error);
const void* sb_packbuff_unpack_bytes(sb_packbuff* pb, size_t* length, int* error);
// Two string items; *value_type is the tag of the value item. On failure the outputs are
// untouched and the cursor is back before the key.
int sb_packbuff_unpack_key_with_string_value(sb_packbuff* pb, const char** key, uint16_t* value_type,
                                             const char** value, size_t* value_length);

// Debugging dump to standard output; returns the number of characters printed.
int sb_packbuff_print(const sb_packbuff* pb);

#ifdef __cplusplus
}
#endif

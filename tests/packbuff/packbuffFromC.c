// Built as C: the header must be usable from C code, and the round trip must work there.
#include "src/packbuff/packbuff.h"

#include <errno.h>
#include <string.h>

#define CHECK(condition)                                                                                     \
    do {                                                                                                     \
        if (!(condition))                                                                                    \
            return __LINE__;                                                                                 \
    } while (0)

// 0 on success, else the line of the first failing check.
int packbuff_round_trip_from_c(void) {
    sb_packbuff* out = sb_packbuff_new(16);
    CHECK(out != NULL);
    CHECK(sb_packbuff_pack_uint32(out, 0, 1) == 0);
    CHECK(sb_packbuff_pack_string(out, 100, "/private/var/root", strlen("/private/var/root")) == 0);
    CHECK(sb_packbuff_pack_bytes(out, 5, "\x01\x02", 2) == 0);
    CHECK(sb_packbuff_pack_key_with_string_value(out, 3, "group", 4, "/g") == 0);
    CHECK(sb_packbuff_get_size(out) == 8 + 8 + 24 + 16 + 16 + 16 + 8);

    sb_packbuff* in = sb_packbuff_init_with_buffer(sb_packbuff_get_bytes(out), sb_packbuff_get_size(out),
                                                   true, SB_PACKBUFF_DEALLOC_NONE);
    CHECK(in != NULL);
    int error = -1;
    size_t length = 0;
    uint16_t tag = 0;
    CHECK(sb_packbuff_unpack_uint32(in, &error) == 1 && error == 0);
    CHECK(sb_packbuff_get_item_value_type(in, &tag) && tag == 100);
    const char* home = sb_packbuff_unpack_string(in, &length, &error);
    CHECK(error == 0 && length == 17 && strcmp(home, "/private/var/root") == 0);
    const unsigned char* data = sb_packbuff_unpack_bytes(in, &length, &error);
    CHECK(error == 0 && length == 2 && data[0] == 1 && data[1] == 2);
    const char* key = NULL;
    const char* value = NULL;
    CHECK(sb_packbuff_unpack_key_with_string_value(in, &key, &tag, &value, &length) == 0);
    CHECK(strcmp(key, "group") == 0 && tag == 4 && strcmp(value, "/g") == 0 && length == 2);
    CHECK(!sb_packbuff_get_item_value_type(in, &tag));
    CHECK(sb_packbuff_skip_item(in) == EINVAL);
    sb_packbuff_free(in);
    sb_packbuff_free(out);
    return 0;
}

// Built as C: the header must be usable from C code. What the items look like and how
// they read back is in the C++ tests.
#include "src/packbuff/packbuff.h"

#include <string.h>

// 0 when a string packed from C reads back with its tag, else 1.
int packbuff_round_trip_from_c(void) {
    sb_packbuff* out = sb_packbuff_new(16);
    sb_packbuff* in = NULL;
    int error = -1;
    size_t length = 0;
    uint16_t tag = 0;
    const char* home = NULL;
    if (out && sb_packbuff_pack_string(out, 100, "/private/var/root", 17) == 0)
        in = sb_packbuff_init_with_buffer(sb_packbuff_get_bytes(out), sb_packbuff_get_size(out), true,
                                          SB_PACKBUFF_DEALLOC_NONE);
    if (in && sb_packbuff_get_item_value_type(in, &tag))
        home = sb_packbuff_unpack_string(in, &length, &error);
    int read = home && tag == 100 && error == 0 && length == 17 && strcmp(home, "/private/var/root") == 0;
    sb_packbuff_free(in);
    sb_packbuff_free(out);
    return read ? 0 : 1;
}

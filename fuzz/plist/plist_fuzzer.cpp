// Holds the direct reader of binary property lists to libplist: whatever bytes it
// accepts, libplist must read to the same value. The input is copied to memory of
// exactly its size so that any read past it is caught.
#include "common/STWPropertyList.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string_view>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::unique_ptr<char[]> copy(new char[size ? size : 1]);
    memcpy(copy.get(), data, size);
    std::string_view bytes(copy.get(), size);
    std::optional<STWValue> direct = STWPropertyList::_parseBinaryDirectly(bytes);
    if (!direct)
        return 0;
    std::optional<STWValue> reference = STWPropertyList::_parseWithLibplist(bytes);
    if (!reference || !direct->isIdenticalTo(*reference)) {
        fprintf(stderr, "plist fuzzer: direct read %s, libplist %s\n", direct->description().c_str(),
                reference ? reference->description().c_str() : "(refused)");
        abort();
    }
    return 0;
}

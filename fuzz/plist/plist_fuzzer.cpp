// Holds the direct reader of binary property lists to libplist: whatever bytes it
// accepts, libplist must read to the same value. The input is copied to memory of
// exactly its size so that any read past it is caught.
#include "common/STWPropertyList.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string_view>

namespace {

// Equal value for value, with reals compared bit for bit (so that NaN equals itself).
bool sameValue(const STWValue& a, const STWValue& b) {
    if (a.type() != b.type())
        return false;
    if (a.type() == STWValue::Type::Real) {
        double x = *a.realValue(), y = *b.realValue();
        return memcmp(&x, &y, sizeof x) == 0;
    }
    if (const STWValue::Array* items = a.array()) {
        const STWValue::Array& others = *b.array();
        if (items->size() != others.size())
            return false;
        for (size_t i = 0; i < items->size(); ++i)
            if (!sameValue((*items)[i], others[i]))
                return false;
        return true;
    }
    if (const STWValue::Dictionary* entries = a.dictionary()) {
        const STWValue::Dictionary& others = *b.dictionary();
        if (entries->size() != others.size())
            return false;
        for (auto i = entries->begin(), j = others.begin(); i != entries->end(); ++i, ++j)
            if (i->first != j->first || !sameValue(i->second, j->second))
                return false;
        return true;
    }
    return a == b;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::unique_ptr<char[]> copy(new char[size ? size : 1]);
    memcpy(copy.get(), data, size);
    std::string_view bytes(copy.get(), size);
    std::optional<STWValue> direct = STWPropertyList::_parseBinaryDirectly(bytes);
    if (!direct)
        return 0;
    std::optional<STWValue> reference = STWPropertyList::_parseWithLibplist(bytes);
    if (!reference || !sameValue(*direct, *reference)) {
        fprintf(stderr, "plist fuzzer: direct read %s, libplist %s\n", direct->description().c_str(),
                reference ? reference->description().c_str() : "(refused)");
        abort();
    }
    return 0;
}

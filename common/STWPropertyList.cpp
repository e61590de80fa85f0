#include "common/STWPropertyList.h"

#include <climits>
#include <cstdlib>
#include <memory>
#include <plist/plist.h>

namespace {

// Seconds between the Unix epoch and 2001-01-01, the property-list date epoch.
constexpr int64_t kPlistEpochOffset = 978307200;
// Nesting deeper than this is refused when reading: hostile files must not exhaust the stack.
constexpr int kMaxDepth = 512;

struct PlistDeleter {
    void operator()(plist_t p) const { plist_free(p); }
};
using PlistPtr = std::unique_ptr<void, PlistDeleter>;

plist_t toPlist(const STWValue& value) {
    switch (value.type()) {
    case STWValue::Type::Null:
        return nullptr;
    case STWValue::Type::Bool:
        return plist_new_bool(*value.boolValue());
    case STWValue::Type::Integer:
        if (auto u = value.uint64Value())
            return plist_new_uint(*u);
        return plist_new_uint(static_cast<uint64_t>(*value.int64Value()));
    case STWValue::Type::Real:
        return plist_new_real(*value.realValue());
    case STWValue::Type::String:
        return plist_new_string(value.string()->c_str());
    case STWValue::Type::Data: {
        const STWData& d = *value.data();
        return plist_new_data(reinterpret_cast<const char*>(d.data()), d.size());
    }
    case STWValue::Type::Date: {
        const STWDate& d = *value.date();
        int64_t sec = d.seconds - kPlistEpochOffset;
        if (sec < INT32_MIN || sec > INT32_MAX)
            sec = sec < 0 ? INT32_MIN : INT32_MAX;
        return plist_new_date(static_cast<int32_t>(sec), static_cast<int32_t>(d.nanoseconds / 1000));
    }
    case STWValue::Type::UUID:
        return plist_new_string(value.uuid()->string().c_str());
    case STWValue::Type::Array: {
        plist_t array = plist_new_array();
        for (const STWValue& item : *value.array())
            if (plist_t p = toPlist(item))
                plist_array_append_item(array, p);
        return array;
    }
    case STWValue::Type::Dictionary: {
        plist_t dict = plist_new_dict();
        for (const auto& [key, item] : *value.dictionary())
            if (plist_t p = toPlist(item))
                plist_dict_set_item(dict, key.c_str(), p);
        return dict;
    }
    }
    return nullptr;
}

std::optional<STWValue> fromPlist(plist_t node, int depth) {
    if (!node || depth > kMaxDepth)
        return std::nullopt;
    switch (plist_get_node_type(node)) {
    case PLIST_BOOLEAN: {
        uint8_t b = 0;
        plist_get_bool_val(node, &b);
        return STWValue(b != 0);
    }
    case PLIST_UINT: {
        uint64_t u = 0;
        plist_get_uint_val(node, &u);
        if (u > static_cast<uint64_t>(INT64_MAX))
            return STWValue(static_cast<int64_t>(u));
        return STWValue(u);
    }
    case PLIST_REAL: {
        double d = 0;
        plist_get_real_val(node, &d);
        return STWValue(d);
    }
    case PLIST_STRING:
    case PLIST_KEY: {
        uint64_t length = 0;
        const char* s = plist_get_string_ptr(node, &length);
        return STWValue(std::string(s ? s : "", s ? length : 0));
    }
    case PLIST_DATA: {
        uint64_t length = 0;
        const char* p = plist_get_data_ptr(node, &length);
        const uint8_t* bytes = reinterpret_cast<const uint8_t*>(p);
        return STWValue(p ? STWData(bytes, bytes + length) : STWData());
    }
    case PLIST_DATE: {
        int32_t sec = 0, usec = 0;
        plist_get_date_val(node, &sec, &usec);
        int64_t total = static_cast<int64_t>(sec) + kPlistEpochOffset;
        int64_t micro = usec;
        if (micro < 0) {
            total -= 1;
            micro += 1000000;
        }
        return STWValue(STWDate{total, static_cast<uint32_t>(micro * 1000)});
    }
    case PLIST_UID: {
        uint64_t u = 0;
        plist_get_uid_val(node, &u);
        return STWValue(u);
    }
    case PLIST_ARRAY: {
        STWValue::Array array;
        uint32_t n = plist_array_get_size(node);
        array.reserve(n);
        for (uint32_t i = 0; i < n; ++i) {
            auto item = fromPlist(plist_array_get_item(node, i), depth + 1);
            if (!item)
                return std::nullopt;
            array.push_back(std::move(*item));
        }
        return STWValue(std::move(array));
    }
    case PLIST_DICT: {
        STWValue::Dictionary dict;
        plist_dict_iter it = nullptr;
        plist_dict_new_iter(node, &it);
        if (!it)
            return STWValue(std::move(dict));
        bool ok = true;
        while (true) {
            char* key = nullptr;
            plist_t item = nullptr;
            plist_dict_next_item(node, it, &key, &item);
            if (!key || !item) {
                free(key);
                break;
            }
            auto value = fromPlist(item, depth + 1);
            if (!value) {
                free(key);
                ok = false;
                break;
            }
            dict.insert_or_assign(key, std::move(*value));
            free(key);
        }
        free(it);
        if (!ok)
            return std::nullopt;
        return STWValue(std::move(dict));
    }
    case PLIST_NONE:
        break;
    }
    return std::nullopt;
}

template <void (*Encode)(plist_t, char**, uint32_t*), void (*Free)(char*)>
std::string serialize(const STWValue& value) {
    PlistPtr root(toPlist(value));
    if (!root)
        return std::string();
    char* bytes = nullptr;
    uint32_t length = 0;
    Encode(root.get(), &bytes, &length);
    std::string out(bytes ? bytes : "", bytes ? length : 0);
    if (bytes)
        Free(bytes);
    return out;
}

} // namespace

namespace STWPropertyList {

std::optional<STWValue> parse(std::string_view bytes) {
    if (bytes.empty() || bytes.size() > UINT32_MAX)
        return std::nullopt;
    plist_t root = nullptr;
    plist_from_memory(bytes.data(), static_cast<uint32_t>(bytes.size()), &root);
    PlistPtr guard(root);
    return fromPlist(root, 0);
}

std::string serializeBinary(const STWValue& value) {
    return serialize<plist_to_bin, plist_to_bin_free>(value);
}

std::string serializeXML(const STWValue& value) {
    return serialize<plist_to_xml, plist_to_xml_free>(value);
}

} // namespace STWPropertyList

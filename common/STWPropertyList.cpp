#include "common/STWPropertyList.h"

#include "common/STWDictionaryUtilities.h"

#include <algorithm>
#include <climits>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <vector>
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

// The seconds since 2001 a date node holds. libplist hands them out only as whole
// seconds toward zero and the size of the fraction, which loses the sign of a fraction
// before 2001 (every rewrite would move such a date); its binary form has the number itself.
double dateSeconds(plist_t node) {
    char* bytes = nullptr;
    uint32_t length = 0;
    plist_to_bin(node, &bytes, &length);
    double seconds = std::nan("");
    // "bplist00", then the lone object: the date marker and a big-endian double.
    if (bytes && length >= 17 && static_cast<uint8_t>(bytes[8]) == 0x33) {
        uint64_t bits = 0;
        for (int i = 9; i < 17; ++i)
            bits = bits << 8 | static_cast<uint8_t>(bytes[i]);
        std::memcpy(&seconds, &bits, sizeof seconds);
    }
    plist_to_bin_free(bytes);
    return seconds;
}

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
        // Text that is not UTF-8 (high bytes in an ASCII string) has no form the writer
        // could give back: such a file is malformed.
        uint64_t length = 0;
        const char* s = plist_get_string_ptr(node, &length);
        auto text = stringWithFileSystemRepresentation(s ? s : "", s ? length : 0);
        if (!text)
            return std::nullopt;
        return STWValue(std::move(*text));
    }
    case PLIST_DATA: {
        uint64_t length = 0;
        const char* p = plist_get_data_ptr(node, &length);
        const uint8_t* bytes = reinterpret_cast<const uint8_t*>(p);
        return STWValue(p ? STWData(bytes, bytes + length) : STWData());
    }
    case PLIST_DATE: {
        // The writer keeps int32 seconds since 2001 and microseconds, as libplist does: a
        // date beyond that range (or no number at all) is read as the earliest date there
        // is, which a write gives back as it is.
        double since2001 = dateSeconds(node);
        if (!(since2001 >= double(INT32_MIN) && since2001 < double(INT32_MAX) + 1))
            return STWValue(STWDate{int64_t(INT32_MIN) + kPlistEpochOffset, 0});
        double whole = std::floor(since2001);
        int64_t total = static_cast<int64_t>(whole) + kPlistEpochOffset;
        int64_t micro = std::llround((since2001 - whole) * 1e6);
        if (micro >= 1000000) {
            total += 1;
            micro -= 1000000;
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
            if (!stringWithFileSystemRepresentation(key)) {
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

// Binary property lists read straight into STWValue.
//
// Every container's metadata file is a small binary property list, and the container
// cache reads all of them; building libplist's node tree only to copy it into STWValue
// allocates everything twice. This reader covers what the daemon writes (booleans,
// integers of up to eight bytes, reals, ASCII strings, data, arrays and dictionaries with
// ASCII keys) and declines everything else: other object types, strings holding a NUL,
// reference cycles, offsets or lengths it does not like, more work than the file's size
// justifies. A declined file goes to libplist as before, so what parse() answers is
// always what libplist answers; the reader only ever accepts a subset of what libplist
// accepts, with the same values.
class BinaryReader {
public:
    // False when the bytes are not a binary property list this reader takes on.
    bool read(std::string_view bytes, STWValue& out) {
        if (!_readTrailer(bytes))
            return false;
        // Shared objects (libplist's writer shares equal values) are read once per use;
        // a file whose references fan out further than this is left to libplist.
        _budget = 8 * _numObjects + 256;
        return _object(_root, 0, out);
    }

    // True when the bytes are a binary property list that libplist must not see: one whose
    // trailer this reader finds wrong, or with a string object that holds a NUL character.
    // libplist stops such a string at the NUL, but a dictionary key that holds one trips an
    // assertion in it and takes the process down. Files whose string objects overlap so
    // much that checking them costs more than a few passes over the file are refused too.
    bool isUnsafeForLibplist(std::string_view bytes) {
        if (bytes.compare(0, 6, "bplist") != 0)
            return false;
        if (!_readTrailer(bytes))
            return true;
        uint64_t budget = 4 * bytes.size();
        for (uint64_t index = 0; index < _numObjects; ++index) {
            uint64_t offset = bigEndian(_base + _offsetTable + index * _offsetSize, _offsetSize);
            // libplist takes an object wherever its offset points, also outside the object
            // area (into the header, the offset table or the trailer), so strings are looked
            // at wherever they are.
            if (offset >= bytes.size())
                continue;
            const uint8_t* p = _base + offset;
            const uint8_t* end = _base + bytes.size();
            uint8_t type = *p & 0xF0, info = *p & 0x0F;
            ++p;
            uint64_t count;
            if ((type != 0x50 && type != 0x60) || !_count(info, p, end, count))
                continue;
            uint64_t size = type == 0x60 ? 2 * std::min<uint64_t>(count, UINT64_MAX / 2) : count;
            size = std::min<uint64_t>(size, static_cast<uint64_t>(end - p));
            if (size > budget)
                return true;
            budget -= size;
            if (type == 0x50 && memchr(p, 0, size))
                return true;
            for (uint64_t i = 0; type == 0x60 && i + 1 < size; i += 2)
                if (p[i] == 0 && p[i + 1] == 0)
                    return true;
        }
        return false;
    }

private:
    bool _readTrailer(std::string_view bytes) {
        static constexpr size_t kHeader = 8, kTrailer = 32;
        if (bytes.size() < kHeader + kTrailer || bytes.compare(0, kHeader, "bplist00") != 0)
            return false;
        _base = reinterpret_cast<const uint8_t*>(bytes.data());
        const uint8_t* trailer = _base + bytes.size() - kTrailer;
        _offsetSize = trailer[6];
        _refSize = trailer[7];
        _numObjects = bigEndian(trailer + 8, 8);
        _root = bigEndian(trailer + 16, 8);
        _offsetTable = bigEndian(trailer + 24, 8);
        uint64_t tableEnd = bytes.size() - kTrailer;
        return _offsetSize >= 1 && _offsetSize <= 8 && _refSize >= 1 && _refSize <= 8 && _numObjects != 0 &&
               _root < _numObjects && _offsetTable >= kHeader && _offsetTable < tableEnd &&
               _numObjects <= (tableEnd - _offsetTable) / _offsetSize;
    }

    static uint64_t bigEndian(const uint8_t* p, unsigned n) {
        uint64_t v = 0;
        for (unsigned i = 0; i < n; ++i)
            v = v << 8 | p[i];
        return v;
    }

    // The count of a data, string, array or dictionary object at `p`: the marker's low
    // nibble, or for 0xF an integer object of up to eight bytes that follows.
    bool _count(uint8_t info, const uint8_t*& p, const uint8_t* end, uint64_t& count) {
        if (info != 0xF) {
            count = info;
            return true;
        }
        if (p >= end || (*p & 0xF0) != 0x10 || (*p & 0x0F) > 3)
            return false;
        unsigned n = 1u << (*p & 0x0F);
        ++p;
        if (static_cast<uint64_t>(end - p) < n)
            return false;
        count = bigEndian(p, n);
        p += n;
        return true;
    }

    // Finds the object at `index`: `p` just past its marker, `end` the end of the object
    // area. False for an index, offset, depth or reference libplist would refuse, and for
    // a file that has used up its budget.
    bool _locate(uint64_t index, int depth, const uint8_t*& p, const uint8_t*& end, uint8_t& type, uint8_t& info) {
        if (index >= _numObjects || depth > kMaxDepth || _budget == 0)
            return false;
        --_budget;
        for (uint64_t ancestor : _path)
            if (ancestor == index)
                return false;
        uint64_t offset = bigEndian(_base + _offsetTable + index * _offsetSize, _offsetSize);
        if (offset < 8 || offset >= _offsetTable)
            return false;
        p = _base + offset;
        end = _base + _offsetTable;
        type = *p & 0xF0;
        info = *p & 0x0F;
        ++p;
        return true;
    }

    // An ASCII string without NUL (libplist ends a string at its first NUL; such rare files
    // are its to read) and without high bytes (which parse() refuses as text that is not
    // UTF-8).
    bool _string(uint8_t info, const uint8_t* p, const uint8_t* end, std::string& out) {
        uint64_t count;
        if (!_count(info, p, end, count) || count > static_cast<uint64_t>(end - p))
            return false;
        for (const uint8_t* c = p; c < p + count; ++c)
            if (*c == 0 || *c >= 0x80)
                return false;
        out.assign(reinterpret_cast<const char*>(p), count);
        return true;
    }

    bool _key(uint64_t index, int depth, std::string& out) {
        const uint8_t *p, *end;
        uint8_t type, info;
        return _locate(index, depth, p, end, type, info) && type == 0x50 && _string(info, p, end, out);
    }

    // The object at `index`, or false to leave the whole file to libplist.
    bool _object(uint64_t index, int depth, STWValue& out) {
        const uint8_t *p, *end;
        uint8_t type, info;
        if (!_locate(index, depth, p, end, type, info))
            return false;
        switch (type) {
        case 0x00:
            if (info != 0x8 && info != 0x9)
                return false;
            out = STWValue(info == 0x9);
            return true;
        case 0x10: {
            if (info > 3)
                return false;
            unsigned n = 1u << info;
            if (static_cast<uint64_t>(end - p) < n)
                return false;
            uint64_t u = bigEndian(p, n);
            if (u > static_cast<uint64_t>(INT64_MAX))
                out = STWValue(static_cast<int64_t>(u));
            else
                out = STWValue(u);
            return true;
        }
        case 0x20: {
            if (info != 2 && info != 3)
                return false;
            unsigned n = 1u << info;
            if (static_cast<uint64_t>(end - p) < n)
                return false;
            uint64_t bits = bigEndian(p, n);
            if (n == 4) {
                float f;
                uint32_t b32 = static_cast<uint32_t>(bits);
                memcpy(&f, &b32, sizeof f);
                out = STWValue(static_cast<double>(f));
            } else {
                double d;
                memcpy(&d, &bits, sizeof d);
                out = STWValue(d);
            }
            return true;
        }
        case 0x40: {
            uint64_t count;
            if (!_count(info, p, end, count) || count > static_cast<uint64_t>(end - p))
                return false;
            out = STWValue(STWData(p, p + count));
            return true;
        }
        case 0x50: {
            std::string text;
            if (!_string(info, p, end, text))
                return false;
            out = STWValue(std::move(text));
            return true;
        }
        case 0xA0: {
            uint64_t count;
            // Every element costs at least one unit of the budget: a count beyond it is
            // declined before anything is allocated for it.
            if (!_count(info, p, end, count) || count > static_cast<uint64_t>(end - p) / _refSize ||
                count > _budget)
                return false;
            out = STWValue(STWValue::Array());
            STWValue::Array& array = *out.mutableArray();
            array.resize(count);
            _path.push_back(index);
            for (uint64_t i = 0; i < count; ++i)
                if (!_object(bigEndian(p + i * _refSize, _refSize), depth + 1, array[i]))
                    return false;
            _path.pop_back();
            return true;
        }
        case 0xD0: {
            uint64_t count;
            if (!_count(info, p, end, count) || count > static_cast<uint64_t>(end - p) / _refSize / 2 ||
                count > _budget / 2)
                return false;
            out = STWValue(STWValue::Dictionary());
            STWValue::Dictionary& dictionary = *out.mutableDictionary();
            _path.push_back(index);
            for (uint64_t i = 0; i < count; ++i) {
                std::string key;
                if (!_key(bigEndian(p + i * _refSize, _refSize), depth + 1, key))
                    return false;
                // Writers emit keys in order, so the end is the usual place; a repeated
                // key keeps the last value, as the libplist route does.
                STWValue& slot = dictionary.insert_or_assign(dictionary.end(), std::move(key), STWValue())->second;
                if (!_object(bigEndian(p + (count + i) * _refSize, _refSize), depth + 1, slot))
                    return false;
            }
            _path.pop_back();
            return true;
        }
        default:
            return false;
        }
    }

    const uint8_t* _base = nullptr;
    uint64_t _numObjects = 0, _root = 0, _offsetTable = 0, _budget = 0;
    unsigned _offsetSize = 0, _refSize = 0;
    std::vector<uint64_t> _path;
};

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
    if (auto value = _parseBinaryDirectly(bytes))
        return value;
    if (BinaryReader().isUnsafeForLibplist(bytes))
        return std::nullopt;
    return _parseWithLibplist(bytes);
}

std::optional<STWValue> _parseBinaryDirectly(std::string_view bytes) {
    STWValue value;
    if (!BinaryReader().read(bytes, value))
        return std::nullopt;
    return value;
}

std::optional<STWValue> _parseWithLibplist(std::string_view bytes) {
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

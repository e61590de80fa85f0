#include "common/STWValue.h"
#include "common/STWSystemCall.h"

#include "common/STWFormat.h"

#include <cinttypes>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <sys/random.h>
#include <unistd.h>

namespace {

void appendQuoted(std::string& out, const std::string& s) {
    out += '"';
    for (char c : s) {
        if (c == '"' || c == '\\')
            out += '\\';
        if (static_cast<unsigned char>(c) < 0x20) {
            char buffer[8];
            snprintf(buffer, sizeof buffer, "\\%03o", static_cast<unsigned char>(c));
            out += buffer;
            continue;
        }
        out += c;
    }
    out += '"';
}

} // namespace

STWUUID STWUUID::random() {
    STWUUID u;
    size_t filled = 0;
    while (filled < u.bytes.size()) {
        ssize_t n = getrandom(u.bytes.data() + filled, u.bytes.size() - filled, 0);
        if (n > 0)
            filled += static_cast<size_t>(n);
    }
    u.bytes[6] = (u.bytes[6] & 0x0f) | 0x40; // version 4
    u.bytes[8] = (u.bytes[8] & 0x3f) | 0x80; // RFC 4122 variant
    return u;
}

std::optional<STWUUID> STWUUID::fromString(std::string_view text) {
    if (text.size() != 36)
        return std::nullopt;
    STWUUID u;
    size_t b = 0;
    for (size_t i = 0; i < text.size();) {
        if (i == 8 || i == 13 || i == 18 || i == 23) {
            if (text[i] != '-')
                return std::nullopt;
            ++i;
            continue;
        }
        int hi = STWHexDigit(text[i]), lo = STWHexDigit(text[i + 1]);
        if (hi < 0 || lo < 0)
            return std::nullopt;
        u.bytes[b++] = static_cast<uint8_t>(hi << 4 | lo);
        i += 2;
    }
    return u;
}

std::string STWUUID::string() const {
    static const char digits[] = "0123456789ABCDEF";
    std::string s;
    s.reserve(36);
    for (size_t i = 0; i < bytes.size(); ++i) {
        if (i == 4 || i == 6 || i == 8 || i == 10)
            s += '-';
        s += digits[bytes[i] >> 4];
        s += digits[bytes[i] & 0xf];
    }
    return s;
}

bool STWUUID::isNull() const {
    for (uint8_t b : bytes)
        if (b)
            return false;
    return true;
}

size_t std::hash<STWUUID>::operator()(const STWUUID& u) const noexcept {
    uint64_t a, b;
    memcpy(&a, u.bytes.data(), 8);
    memcpy(&b, u.bytes.data() + 8, 8);
    return STWHashCombine(std::hash<uint64_t>()(a), std::hash<uint64_t>()(b));
}

STWDate STWDate::now() {
    timespec ts;
    clock_gettime(CLOCK_REALTIME, &ts);
    return STWDate{ts.tv_sec, static_cast<uint32_t>(ts.tv_nsec)};
}

std::string STWDate::description() const {
    time_t t = static_cast<time_t>(seconds);
    tm parts;
    char buffer[64];
    if (!gmtime_r(&t, &parts) || !strftime(buffer, sizeof buffer, "%Y-%m-%d %H:%M:%S +0000", &parts))
        snprintf(buffer, sizeof buffer, "@%" PRId64, seconds);
    return buffer;
}

STWValue::Type STWValue::type() const {
    switch (_v.index()) {
    case 0:
        return Type::Null;
    case 1:
        return Type::Bool;
    case 2:
    case 3:
        return Type::Integer;
    case 4:
        return Type::Real;
    case 5:
        return Type::String;
    case 6:
        return Type::Data;
    case 7:
        return Type::Date;
    case 8:
        return Type::UUID;
    case 9:
        return Type::Array;
    default:
        return Type::Dictionary;
    }
}

std::optional<bool> STWValue::boolValue() const {
    if (auto b = std::get_if<bool>(&_v))
        return *b;
    return std::nullopt;
}

std::optional<uint64_t> STWValue::uint64Value() const {
    if (auto u = std::get_if<uint64_t>(&_v))
        return *u;
    return std::nullopt;
}

std::optional<int64_t> STWValue::int64Value() const {
    if (auto i = std::get_if<int64_t>(&_v))
        return *i;
    if (auto u = std::get_if<uint64_t>(&_v); u && *u <= static_cast<uint64_t>(INT64_MAX))
        return static_cast<int64_t>(*u);
    return std::nullopt;
}

std::optional<double> STWValue::realValue() const {
    if (auto d = std::get_if<double>(&_v))
        return *d;
    if (auto i = std::get_if<int64_t>(&_v))
        return static_cast<double>(*i);
    if (auto u = std::get_if<uint64_t>(&_v))
        return static_cast<double>(*u);
    return std::nullopt;
}

std::optional<int64_t> STWValue::truncatedInt64Value() const {
    if (auto i = int64Value())
        return i;
    auto d = std::get_if<double>(&_v);
    // 2^63 is exact in a double; every double below it (and from -2^63 up) fits.
    if (!d || !(*d >= -9223372036854775808.0 && *d < 9223372036854775808.0))
        return std::nullopt;
    return static_cast<int64_t>(*d);
}

const std::string* STWValue::string() const {
    return std::get_if<std::string>(&_v);
}
const STWData* STWValue::data() const {
    return std::get_if<STWData>(&_v);
}
const STWDate* STWValue::date() const {
    return std::get_if<STWDate>(&_v);
}
const STWUUID* STWValue::uuid() const {
    return std::get_if<STWUUID>(&_v);
}

const STWValue::Array* STWValue::array() const {
    auto b = std::get_if<Box<Array>>(&_v);
    return b ? b->p.get() : nullptr;
}

const STWValue::Dictionary* STWValue::dictionary() const {
    auto b = std::get_if<Box<Dictionary>>(&_v);
    return b ? b->p.get() : nullptr;
}

STWValue::Array* STWValue::mutableArray() {
    auto b = std::get_if<Box<Array>>(&_v);
    return b ? b->p.get() : nullptr;
}

STWValue::Dictionary* STWValue::mutableDictionary() {
    auto b = std::get_if<Box<Dictionary>>(&_v);
    return b ? b->p.get() : nullptr;
}

const STWValue* STWValue::find(std::string_view key) const {
    const Dictionary* d = dictionary();
    return d ? STWDictionaryFind(*d, key) : nullptr;
}

bool STWValue::operator==(const STWValue& other) const {
    return _v == other._v;
}

bool STWValue::isIdenticalTo(const STWValue& other) const {
    if (type() != other.type())
        return false;
    if (type() == Type::Real) {
        double x = *realValue(), y = *other.realValue();
        return memcmp(&x, &y, sizeof x) == 0;
    }
    if (const Array* items = array()) {
        const Array& others = *other.array();
        if (items->size() != others.size())
            return false;
        for (size_t i = 0; i < items->size(); ++i)
            if (!(*items)[i].isIdenticalTo(others[i]))
                return false;
        return true;
    }
    if (const Dictionary* entries = dictionary()) {
        const Dictionary& others = *other.dictionary();
        if (entries->size() != others.size())
            return false;
        for (auto i = entries->begin(), j = others.begin(); i != entries->end(); ++i, ++j)
            if (i->first != j->first || !i->second.isIdenticalTo(j->second))
                return false;
        return true;
    }
    return *this == other;
}

size_t STWValue::hash() const {
    size_t seed = std::hash<size_t>()(_v.index());
    switch (_v.index()) {
    case 0:
        return seed;
    case 1:
        return STWHashCombine(seed, std::get<bool>(_v));
    case 2:
        return STWHashCombine(seed, std::hash<uint64_t>()(std::get<uint64_t>(_v)));
    case 3:
        return STWHashCombine(seed, std::hash<int64_t>()(std::get<int64_t>(_v)));
    case 4:
        return STWHashCombine(seed, std::hash<double>()(std::get<double>(_v)));
    case 5:
        return STWHashCombine(seed, std::hash<std::string>()(std::get<std::string>(_v)));
    case 6: {
        const STWData& d = std::get<STWData>(_v);
        return STWHashCombine(seed, std::hash<std::string_view>()(
                                 std::string_view(reinterpret_cast<const char*>(d.data()), d.size())));
    }
    case 7: {
        const STWDate& d = std::get<STWDate>(_v);
        return STWHashCombine(STWHashCombine(seed, std::hash<int64_t>()(d.seconds)), d.nanoseconds);
    }
    case 8:
        return STWHashCombine(seed, std::hash<STWUUID>()(std::get<STWUUID>(_v)));
    case 9:
        for (const STWValue& v : *array())
            seed = STWHashCombine(seed, v.hash());
        return seed;
    default:
        for (const auto& [k, v] : *dictionary())
            seed = STWHashCombine(STWHashCombine(seed, std::hash<std::string>()(k)), v.hash());
        return seed;
    }
}

std::string STWValue::description() const {
    std::string out;
    char buffer[64];
    switch (type()) {
    case Type::Null:
        return "(null)";
    case Type::Bool:
        return std::get<bool>(_v) ? "true" : "false";
    case Type::Integer:
        if (auto u = std::get_if<uint64_t>(&_v))
            snprintf(buffer, sizeof buffer, "%" PRIu64, *u);
        else
            snprintf(buffer, sizeof buffer, "%" PRId64, std::get<int64_t>(_v));
        return buffer;
    case Type::Real:
        snprintf(buffer, sizeof buffer, "%.17g", std::get<double>(_v));
        return buffer;
    case Type::String:
        appendQuoted(out, std::get<std::string>(_v));
        return out;
    case Type::Data: {
        const STWData& d = std::get<STWData>(_v);
        out = "<";
        for (size_t i = 0; i < d.size() && i < 64; ++i) {
            snprintf(buffer, sizeof buffer, "%02x", d[i]);
            out += buffer;
        }
        if (d.size() > 64)
            out += "... " + std::to_string(d.size()) + " bytes";
        return out + ">";
    }
    case Type::Date:
        return std::get<STWDate>(_v).description();
    case Type::UUID:
        return std::get<STWUUID>(_v).string();
    case Type::Array: {
        out = "(";
        bool first = true;
        for (const STWValue& v : *array()) {
            out += first ? "" : ", ";
            out += v.description();
            first = false;
        }
        return out + ")";
    }
    case Type::Dictionary:
        return STWDescribeDictionary(*dictionary());
    }
    return out;
}

std::string STWDescribeDictionary(const STWValue::Dictionary& dictionary) {
    std::string out = "{";
    for (const auto& [k, v] : dictionary) {
        out += ' ';
        appendQuoted(out, k);
        out += " = " + v.description() + ";";
    }
    return out + (dictionary.empty() ? "}" : " }");
}

const STWValue* STWDictionaryFind(const STWValue::Dictionary& dictionary, std::string_view key) {
    auto it = dictionary.find(key);
    return it == dictionary.end() ? nullptr : &it->second;
}

std::optional<uint64_t> STWDictionaryUInt64(const STWValue::Dictionary& dictionary, std::string_view key) {
    const STWValue* v = STWDictionaryFind(dictionary, key);
    return v ? v->uint64Value() : std::nullopt;
}

bool STWDictionaryBool(const STWValue::Dictionary& dictionary, std::string_view key) {
    const STWValue* v = STWDictionaryFind(dictionary, key);
    return v && v->boolValue().value_or(false);
}

const std::string* STWDictionaryString(const STWValue::Dictionary& dictionary, std::string_view key) {
    const STWValue* v = STWDictionaryFind(dictionary, key);
    return v ? v->string() : nullptr;
}

const STWValue::Dictionary* STWDictionaryDictionary(const STWValue::Dictionary& dictionary,
                                                    std::string_view key) {
    const STWValue* v = STWDictionaryFind(dictionary, key);
    return v ? v->dictionary() : nullptr;
}

bool STWIsValidUTF8(std::string_view text) {
    const auto* p = reinterpret_cast<const unsigned char*>(text.data());
    size_t length = text.size();
    size_t i = 0;
    while (i < length) {
        unsigned char c = p[i];
        size_t extra;
        uint32_t min;
        if (c < 0x80) {
            ++i;
            continue;
        } else if ((c & 0xe0) == 0xc0) {
            extra = 1;
            min = 0x80;
        } else if ((c & 0xf0) == 0xe0) {
            extra = 2;
            min = 0x800;
        } else if ((c & 0xf8) == 0xf0) {
            extra = 3;
            min = 0x10000;
        } else {
            return false;
        }
        if (length - i <= extra)
            return false;
        uint32_t cp = c & (0x3f >> extra);
        for (size_t k = 1; k <= extra; ++k) {
            if ((p[i + k] & 0xc0) != 0x80)
                return false;
            cp = cp << 6 | (p[i + k] & 0x3f);
        }
        if (cp < min || cp > 0x10ffff || (cp >= 0xd800 && cp <= 0xdfff))
            return false;
        i += extra + 1;
    }
    return true;
}

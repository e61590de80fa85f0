// The one property-list value type of the daemon.
//
// Entitlements, info dictionaries, message bodies and every property-list file pass
// through STWValue; the conversions to libplist (STWPropertyList.h) and to the IPC codec
// live beside it, so no other layer touches plist_t or MessagePack objects. Values have
// value semantics: copies are deep, equality is deep, and a typed read of a value of
// another type reads as absent.
#pragma once

#include <array>
#include <compare>
#include <concepts>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

struct STWUUID {
    std::array<uint8_t, 16> bytes{};

    static STWUUID random();
    // Accepts the canonical 8-4-4-4-12 form in either case.
    static std::optional<STWUUID> fromString(std::string_view text);
    // Upper-case canonical form, as written into metadata files and directory names.
    std::string string() const;
    std::string description() const { return string(); }
    bool isNull() const;
    auto operator<=>(const STWUUID&) const = default;
};

// A point in time, seconds and nanoseconds since the Unix epoch.
struct STWDate {
    int64_t seconds = 0;
    uint32_t nanoseconds = 0;

    static STWDate now();
    std::string description() const; // ISO 8601, UTC
    auto operator<=>(const STWDate&) const = default;
};

using STWData = std::vector<uint8_t>;

class STWValue {
public:
    enum class Type { Null, Bool, Integer, Real, String, Data, Date, UUID, Array, Dictionary };
    using Array = std::vector<STWValue>;
    using Dictionary = std::map<std::string, STWValue, std::less<>>;

    STWValue() = default;
    STWValue(std::nullptr_t) {}
    STWValue(bool v) : _v(v) {}
    template <std::integral T>
    requires(!std::is_same_v<T, bool>) STWValue(T v) {
        if constexpr (std::is_signed_v<T>) {
            if (v < 0) {
                _v = static_cast<int64_t>(v);
                return;
            }
        }
        _v = static_cast<uint64_t>(v);
    }
    STWValue(double v) : _v(v) {}
    STWValue(const char* v) : _v(std::string(v ? v : "")) {}
    STWValue(std::string_view v) : _v(std::string(v)) {}
    STWValue(std::string v) : _v(std::move(v)) {}
    STWValue(STWData v) : _v(std::move(v)) {}
    STWValue(STWDate v) : _v(v) {}
    STWValue(STWUUID v) : _v(v) {}
    STWValue(Array v) : _v(Box<Array>(std::move(v))) {}
    STWValue(Dictionary v) : _v(Box<Dictionary>(std::move(v))) {}

    Type type() const;
    bool isNull() const { return type() == Type::Null; }
    bool isNumber() const { return type() == Type::Integer || type() == Type::Real; }
    bool isDictionary() const { return type() == Type::Dictionary; }
    bool isArray() const { return type() == Type::Array; }
    bool isString() const { return type() == Type::String; }

    // Typed reads. Integers: uint64 accepts any non-negative integer, int64 any integer
    // that fits; neither accepts a real or a boolean.
    std::optional<bool> boolValue() const;
    std::optional<uint64_t> uint64Value() const;
    std::optional<int64_t> int64Value() const;
    std::optional<double> realValue() const; // any number
    // Any number read as an integer: a real truncated toward zero; nullopt for what is no
    // number or lies outside int64 (where a plain cast would be undefined).
    std::optional<int64_t> truncatedInt64Value() const;
    const std::string* string() const;
    const STWData* data() const;
    const STWDate* date() const;
    const STWUUID* uuid() const;
    const Array* array() const;
    const Dictionary* dictionary() const;
    Array* mutableArray();
    Dictionary* mutableDictionary();

    // Dictionary access: nullptr when this is not a dictionary or the key is absent.
    const STWValue* find(std::string_view key) const;

    bool operator==(const STWValue& other) const;
    // Equal value for value, with reals compared bit for bit, so that a NaN is identical
    // to itself (it is never == to anything). For checking that a value survived a round
    // trip unchanged.
    bool isIdenticalTo(const STWValue& other) const;
    size_t hash() const;
    std::string description() const;

private:
    // Deep-copying box so that the variant can hold containers of STWValue.
    template <class T>
    struct Box {
        std::unique_ptr<T> p;
        Box() : p(std::make_unique<T>()) {}
        explicit Box(T v) : p(std::make_unique<T>(std::move(v))) {}
        Box(const Box& o) : p(std::make_unique<T>(*o.p)) {}
        Box(Box&&) noexcept = default;
        Box& operator=(const Box& o) {
            if (this != &o)
                p = std::make_unique<T>(*o.p);
            return *this;
        }
        Box& operator=(Box&&) noexcept = default;
        bool operator==(const Box& o) const { return *p == *o.p; }
    };

    std::variant<std::monostate, bool, uint64_t, int64_t, double, std::string, STWData, STWDate, STWUUID,
                 Box<Array>, Box<Dictionary>>
        _v;
};

std::string STWDescribeDictionary(const STWValue::Dictionary& dictionary);

// Typed reads from a dictionary, for decoding message bodies and files.
const STWValue* STWDictionaryFind(const STWValue::Dictionary& dictionary, std::string_view key);
std::optional<uint64_t> STWDictionaryUInt64(const STWValue::Dictionary& dictionary, std::string_view key);
// A message flag: true only for a boolean true; absent or mistyped reads as false.
bool STWDictionaryBool(const STWValue::Dictionary& dictionary, std::string_view key);
const std::string* STWDictionaryString(const STWValue::Dictionary& dictionary, std::string_view key);
const STWValue::Dictionary* STWDictionaryDictionary(const STWValue::Dictionary& dictionary,
                                                    std::string_view key);

// Text is UTF-8 throughout the daemon: true when `text` is well-formed UTF-8 (shortest
// forms, no surrogates, nothing above U+10FFFF).
bool STWIsValidUTF8(std::string_view text);

template <>
struct std::hash<STWValue> {
    size_t operator()(const STWValue& v) const { return v.hash(); }
};
template <>
struct std::hash<STWUUID> {
    size_t operator()(const STWUUID& u) const noexcept;
};

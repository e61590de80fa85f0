// printf-style formatting for the daemon's own message texts.
//
// Messages are written as the system states them ("Invalid metadata UUID: %@ at %@"),
// with "%@" standing for an object's description. Formatting is driven by the argument's
// real type, so a conversion that does not match its argument still prints something
// sensible instead of reading garbage: log lines are built from hostile input too.
#pragma once

#include <array>
#include <concepts>
#include <cstdint>
#include <filesystem>
#include <initializer_list>
#include <memory>
#include <string>
#include <string_view>
#include <type_traits>

class STWError;

template <class T>
concept STWDescribable = requires(const T& t) {
    { t.description() } -> std::convertible_to<std::string>;
};

class STWFormatArg {
public:
    enum class Kind { Signed, Unsigned, Real, Text, Object, Pointer, Null };

    template <class T>
    requires(std::is_integral_v<T> && !std::is_same_v<T, bool>) STWFormatArg(T v) {
        if constexpr (std::is_signed_v<T>) {
            _kind = Kind::Signed;
            _signed = v;
        } else {
            _kind = Kind::Unsigned;
            _unsigned = v;
        }
    }
    STWFormatArg(bool v) : _kind(Kind::Text), _text(v ? "YES" : "NO") {}
    STWFormatArg(double v) : _kind(Kind::Real), _real(v) {}
    STWFormatArg(const char* s) : _kind(s ? Kind::Text : Kind::Null), _text(s ? s : "") {}
    STWFormatArg(std::string_view s) : _kind(Kind::Text), _text(s) {}
    STWFormatArg(const std::string& s) : _kind(Kind::Text), _text(s) {}
    STWFormatArg(const std::filesystem::path& p) : _kind(Kind::Text), _text(p.native()) {}
    STWFormatArg(std::nullptr_t) : _kind(Kind::Null) {}
    STWFormatArg(const void* p) : _kind(p ? Kind::Pointer : Kind::Null), _pointer(p) {}

    template <STWDescribable T>
    STWFormatArg(const T& object)
        : _kind(Kind::Object), _object(&object),
          _describe([](const void* o) { return static_cast<const T*>(o)->description(); }),
          _isError(std::is_same_v<std::remove_cv_t<T>, STWError>) {}

    template <STWDescribable T>
    STWFormatArg(const std::shared_ptr<T>& object) : STWFormatArg(object.get()) {}

    template <STWDescribable T>
    STWFormatArg(T* object) {
        if (!object) {
            _kind = Kind::Null;
            return;
        }
        _kind = Kind::Object;
        _object = object;
        _describe = [](const void* o) { return static_cast<const T*>(o)->description(); };
        _isError = std::is_same_v<std::remove_cv_t<T>, STWError>;
    }

    Kind kind() const { return _kind; }
    int64_t signedValue() const;
    uint64_t unsignedValue() const;
    double realValue() const { return _real; }
    const void* pointer() const { return _kind == Kind::Pointer ? _pointer : _object; }
    // What "%@" prints: the object's description, the text itself, the number in decimal.
    std::string description() const;
    // The error object this argument is (an STWError, by reference, pointer or shared
    // pointer), else nullptr: the log facade files an entry under its first error's code.
    const STWError* error() const { return _isError ? static_cast<const STWError*>(_object) : nullptr; }

private:
    Kind _kind = Kind::Null;
    int64_t _signed = 0;
    uint64_t _unsigned = 0;
    double _real = 0;
    std::string_view _text;
    const void* _pointer = nullptr;
    const void* _object = nullptr;
    std::string (*_describe)(const void*) = nullptr;
    bool _isError = false;
};

// Formats `format` with `args`. Understands %@, %s, %d, %i, %u, %x, %X, %o, %c, %p, %f,
// %e, %g and %%, with flags, width, precision and the length modifiers hh, h, l, ll, z,
// j and t; annotations in braces ("%{public}s") are skipped. A missing argument prints
// "(missing)".
std::string STWFormatv(std::string_view format, std::initializer_list<STWFormatArg> args);

template <class... Args>
std::string STWFormat(std::string_view format, const Args&... args) {
    return STWFormatv(format, {STWFormatArg(args)...});
}

// The value of one hexadecimal digit (either case), or -1. A table rather than range tests:
// the digits of UUIDs and digests come in no order a branch predictor could learn, and a
// rebuild parses the UUID name of every container it lists.
inline int STWHexDigit(char c) {
    static constexpr auto values = [] {
        std::array<int8_t, 256> table{};
        table.fill(-1);
        for (int i = 0; i < 10; ++i)
            table['0' + i] = static_cast<int8_t>(i);
        for (int i = 0; i < 6; ++i)
            table['a' + i] = table['A' + i] = static_cast<int8_t>(10 + i);
        return table;
    }();
    return values[static_cast<unsigned char>(c)];
}
// Lower-case hexadecimal text of `length` bytes.
std::string STWHexString(const unsigned char* bytes, size_t length);

#include "common/STWMessagePack.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <string>

inline void PrintTo(const STWValue& value, std::ostream* os) {
    *os << value.description();
}

namespace {

std::string bytes(std::initializer_list<int> list) {
    std::string s;
    for (int b : list)
        s.push_back(static_cast<char>(b));
    return s;
}

std::optional<STWValue> decode(const std::string& input, std::string* reason = nullptr) {
    return STWMessagePackDecode(input, reason);
}

STWValue roundTrip(const STWValue& value) {
    std::string reason;
    auto back = decode(STWMessagePackEncode(value), &reason);
    EXPECT_TRUE(back) << reason;
    return back.value_or(STWValue("<failed>"));
}

std::string nestedArrays(size_t depth) {
    return std::string(depth, '\x91') + '\xc0'; // [[[...[nil]...]]]
}

} // namespace

TEST(STWMessagePack, EveryTypeRoundTrips) {
    STWUUID uuid = *STWUUID::fromString("01234567-89AB-CDEF-0011-223344556677");
    STWValue value(STWValue::Dictionary{
        {"nil", STWValue()},
        {"true", STWValue(true)},
        {"false", STWValue(false)},
        {"zero", STWValue(0)},
        {"uint64max", STWValue(UINT64_MAX)},
        {"int64min", STWValue(INT64_MIN)},
        {"negative", STWValue(-1)},
        {"real", STWValue(-0.125)},
        {"string", STWValue("h\xc3\xa9llo")},
        {"emptyString", STWValue("")},
        {"data", STWValue(STWData{0, 0xff, 0x80})},
        {"emptyData", STWValue(STWData{})},
        {"uuid", STWValue(uuid)},
        {"date", STWValue(STWDate{1700000000, 123456789})},
        {"dateBefore1970", STWValue(STWDate{-86400, 5})},
        {"dateBeyond34Bits", STWValue(STWDate{int64_t(1) << 40, 0})},
        {"array", STWValue(STWValue::Array{STWValue(1), STWValue("two"), STWValue(STWValue::Array{})})},
        {"dictionary", STWValue(STWValue::Dictionary{{"", STWValue(STWValue::Dictionary{})}})},
    });
    EXPECT_EQ(roundTrip(value), value);
    // Integers that are not negative read back unsigned whatever their encoded width.
    EXPECT_EQ(roundTrip(STWValue(int64_t(5))).uint64Value(), 5u);
    // A real stays a real when it has no fraction, and keeps its sign at zero.
    EXPECT_EQ(roundTrip(STWValue(2.0)).type(), STWValue::Type::Real);
    auto negativeZero = roundTrip(STWValue(-0.0)).realValue();
    ASSERT_TRUE(negativeZero);
    EXPECT_TRUE(std::signbit(*negativeZero));
    EXPECT_TRUE(std::isnan(*roundTrip(STWValue(std::nan(""))).realValue()));
}

TEST(STWMessagePack, WireForms) {
    // Dates that fit 34 bits of seconds use the 64-bit timestamp, others the 96-bit one.
    EXPECT_EQ(STWMessagePackEncode(STWValue(STWDate{1, 2})),
              bytes({0xd7, 0xff, 0, 0, 0, 0x08, 0, 0, 0, 0x01}));
    EXPECT_EQ(STWMessagePackEncode(STWValue(STWDate{-1, 0})).substr(0, 3), bytes({0xc7, 12, 0xff}));
    EXPECT_EQ(STWMessagePackEncode(STWValue(STWUUID{})).substr(0, 2), bytes({0xd8, 0x01}));
    // Out-of-range nanoseconds are carried into the seconds rather than written invalid.
    EXPECT_EQ(roundTrip(STWValue(STWDate{10, 2500000000u})), STWValue(STWDate{12, 500000000}));

    // Forms this side never writes read as their value; unknown or malformed extensions as nil.
    const std::pair<std::string, STWValue> foreign[] = {
        {bytes({0xd6, 0xff, 0x65, 0x53, 0xf1, 0x00}), STWValue(STWDate{1700000000, 0})}, // 32-bit timestamp
        {bytes({0xca, 0x3f, 0xc0, 0, 0}), STWValue(1.5)},                                // float32
        {bytes({0xd0, 0x05}), STWValue(uint64_t(5))}, // int8 that is positive
        {bytes({0xd3, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xfe}), STWValue(int64_t(-2))},
        {bytes({0xcf, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff}), STWValue(UINT64_MAX)},
        {bytes({0xda, 0, 2, 'h', 'i'}), STWValue("hi")},        // str16 for a short string
        {bytes({0xd4, 0x07, 0x00}), STWValue()},                // extension 7
        {bytes({0xd6, 0x01, 1, 2, 3, 4}), STWValue()},          // a UUID of 4 bytes
        {bytes({0xc7, 0x05, 0xff, 0, 0, 0, 0, 0}), STWValue()}, // a timestamp of 5 bytes
        {bytes({0xc7, 12, 0xff, 0x3b, 0x9a, 0xca, 0, 0, 0, 0, 0, 0, 0, 0, 0}), STWValue()}, // 1e9 nanoseconds
    };
    for (const auto& [input, value] : foreign) {
        std::string reason;
        EXPECT_EQ(decode(input, &reason), value) << reason;
    }
}

TEST(STWMessagePack, RefusesBrokenInput) {
    struct Case {
        const char* what;
        std::string input;
        const char* reason = "";
    } cases[] = {
        {"empty", ""},
        {"reserved byte", bytes({0xc1})},
        {"trailing bytes", bytes({0xc0, 0xc0})},
        {"str8 without its length", bytes({0xd9})},
        {"uint32 cut short", bytes({0xce, 0, 0})},
        {"array missing an element", bytes({0x92, 0x01})},
        {"map missing a value", bytes({0x81, 0xa1, 'k'})},
        {"integer key", bytes({0x81, 0x01, 0xc0})},
        {"binary key", bytes({0x81, 0xc4, 0x01, 'k', 0xc0})},
        {"duplicate key", bytes({0x82, 0xa1, 'k', 0x01, 0xa1, 'k', 0x02})},
        {"string that is not UTF-8", bytes({0xa2, 0xc3, 0x28})},
        {"overlong UTF-8", bytes({0xa2, 0xc0, 0xaf})},
        {"string with a NUL", bytes({0xa3, 'a', 0, 'b'})},
        {"key with a NUL", bytes({0x81, 0xa2, 'k', 0, 0xc0})},
        // Each declares far more elements or bytes than there are; the decoder must say
        // no rather than try to make room for them.
        {"array32", bytes({0xdd, 0xff, 0xff, 0xff, 0xff, 0xc0}), "beyond the end"},
        {"map32", bytes({0xdf, 0xff, 0xff, 0xff, 0xff, 0xa1, 'k', 0xc0}), "beyond the end"},
        {"str32", bytes({0xdb, 0xff, 0xff, 0xff, 0xff, 'a'}), "beyond the end"},
        {"bin32", bytes({0xc6, 0xff, 0xff, 0xff, 0xff, 'a'}), "beyond the end"},
        {"ext32", bytes({0xc9, 0xff, 0xff, 0xff, 0xff, 0x01, 'a'}), "beyond the end"},
        {"array16 one short", bytes({0xdc, 0x00, 0x03, 0xc0, 0xc0}), "beyond the end"},
        {"str8 one short", bytes({0xd9, 0x03, 'a', 'b'}), "beyond the end"},
    };
    for (const Case& c : cases) {
        std::string reason;
        EXPECT_FALSE(decode(c.input, &reason)) << c.what;
        EXPECT_FALSE(reason.empty()) << c.what;
        EXPECT_NE(reason.find(c.reason), std::string::npos) << c.what << ": " << reason;
    }
    EXPECT_FALSE(decode(bytes({0x81, 0x01, 0xc0}))); // reason is optional
    // Nested headers, each within what remains but together far beyond it.
    std::string nested;
    for (int i = 0; i < 60; ++i)
        nested += bytes({0xdc, 0x01, 0x00}); // array16 of 256
    EXPECT_FALSE(decode(nested + std::string(300, '\xc0')));
}

TEST(STWMessagePack, EveryTruncationOfAValidObjectIsRefused) {
    std::string full = STWMessagePackEncode(STWValue(STWValue::Dictionary{
        {"list", STWValue(STWValue::Array{STWValue(UINT64_MAX), STWValue(-300), STWValue(2.5)})},
        {"blob", STWValue(STWData(300, 7))},
        {"text", STWValue(std::string(70000, 'x'))},
        {"when", STWValue(STWDate{-5, 1})},
        {"id", STWValue(STWUUID::random())},
    }));
    ASSERT_TRUE(decode(full));
    for (size_t length = 0; length < full.size(); length += (length < 400 ? 1 : 997))
        EXPECT_FALSE(decode(full.substr(0, length))) << "prefix of " << length << " bytes";
}

TEST(STWMessagePack, NestingAndObjectCountAreLimited) {
    EXPECT_TRUE(decode(nestedArrays(STWMessagePackMaxDepth)));
    std::string reason;
    EXPECT_FALSE(decode(nestedArrays(STWMessagePackMaxDepth + 1), &reason));
    EXPECT_NE(reason.find("deep"), std::string::npos) << reason;
    // An empty container at the limit counts as a level too.
    EXPECT_FALSE(decode(std::string(STWMessagePackMaxDepth, '\x91') + '\x90'));
    // Maps nest the same way, and a very deep input is refused without recursing.
    std::string maps;
    for (size_t i = 0; i <= STWMessagePackMaxDepth; ++i)
        maps += bytes({0x81, 0xa1, 'k'});
    EXPECT_FALSE(decode(maps + '\xc0'));
    EXPECT_FALSE(decode(nestedArrays(1000000)));

    auto arrayOfNils = [](size_t count) {
        std::string s = bytes({0xdd, int(count >> 24 & 0xff), int(count >> 16 & 0xff), int(count >> 8 & 0xff),
                               int(count & 0xff)});
        return s + std::string(count, '\xc0');
    };
    // The array itself is one object.
    EXPECT_TRUE(decode(arrayOfNils(STWMessagePackMaxObjects - 1)));
    EXPECT_FALSE(decode(arrayOfNils(STWMessagePackMaxObjects), &reason));
    EXPECT_NE(reason.find("too many"), std::string::npos) << reason;
    // A receiver may set a lower limit of its own.
    EXPECT_TRUE(STWMessagePackDecode(arrayOfNils(99), nullptr, 100));
    EXPECT_FALSE(STWMessagePackDecode(arrayOfNils(100), nullptr, 100));
}

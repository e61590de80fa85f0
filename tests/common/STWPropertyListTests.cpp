#include "common/STWDictionaryUtilities.h"
#include "common/STWPropertyList.h"

#include <gtest/gtest.h>

#include <csignal>
#include <filesystem>
#include <fstream>
#include <sys/resource.h>

// Readable values in failure messages.
inline void PrintTo(const STWValue& value, std::ostream* os) {
    *os << value.description();
}

namespace {

STWValue::Dictionary everyType() {
    return STWValue::Dictionary{
        {"bool", STWValue(false)},
        {"uint", STWValue(uint64_t(4000000000ull))},
        {"negative", STWValue(int64_t(-42))},
        {"real", STWValue(0.25)},
        {"string", STWValue("h\xc3\xa9llo <&>")},
        {"data", STWValue(STWData{0, 0xff, 0x10})},
        {"date", STWValue(STWDate{1700000000, 0})},
        {"array", STWValue(STWValue::Array{STWValue(1), STWValue("two"), STWValue(STWValue::Array{})})},
        {"dict",
         STWValue(STWValue::Dictionary{{"nested", STWValue(STWValue::Dictionary{{"x", STWValue(1)}})}})},
        {"empty", STWValue("")},
    };
}

class STWPropertyListFileTest : public ::testing::Test {
protected:
    void SetUp() override {
        char templ[] = "/tmp/stowly-plist-XXXXXX";
        ASSERT_NE(mkdtemp(templ), nullptr);
        dir = templ;
    }
    void TearDown() override { std::filesystem::remove_all(dir); }
    std::filesystem::path dir;
};

TEST(STWPropertyList, EveryTypeRoundTripsThroughBinaryAndXML) {
    STWValue value(everyType());
    for (const std::string& bytes :
         {STWPropertyList::serializeBinary(value), STWPropertyList::serializeXML(value)}) {
        auto back = STWPropertyList::parse(bytes);
        ASSERT_TRUE(back);
        EXPECT_EQ(*back, value) << back->description();
    }
    EXPECT_EQ(STWPropertyList::serializeBinary(value).substr(0, 8), "bplist00");
    // Binary files keep fractions of a second (to the microsecond), also before 2001 and
    // within a second of it; UUIDs are written as their string.
    STWUUID u = STWUUID::random();
    STWValue::Array dates{STWValue(STWDate{1700000000, 250000000}), STWValue(STWDate{978307200 - 2144, 400000000}),
                          STWValue(STWDate{978307199, 750000000})};
    STWValue precise(STWValue::Dictionary{{"d", STWValue(dates)}, {"u", STWValue(u)}});
    EXPECT_EQ(STWPropertyList::parse(STWPropertyList::serializeBinary(precise)),
              STWValue(STWValue::Dictionary{{"d", STWValue(dates)}, {"u", STWValue(u.string())}}));
    // A date beyond what libplist holds (-4.8e216 s, +7.4e10 s) is read as one that a write keeps.
    for (const char* bits : {"\xec\xeb\xa0\xef\xd8\x9c\x90\x6d", "\x42\x31\x41\x39\x35\x34\x32\xd5"}) {
        std::string far =
            STWPropertyList::serializeBinary(STWValue(STWValue::Dictionary{{"d", STWValue(STWDate{978307200, 0})}}));
        far.replace(far.find(std::string("\x33\0\0\0\0\0\0\0\0", 9)) + 1, 8, bits);
        auto farRead = STWPropertyList::parse(far);
        ASSERT_TRUE(farRead);
        EXPECT_EQ(STWPropertyList::parse(STWPropertyList::serializeBinary(*farRead)), farRead);
    }
}

TEST(STWPropertyList, CorruptAndTruncatedBytesAreRefused) {
    std::string binary = STWPropertyList::serializeBinary(STWValue(everyType()));
    std::string xml = STWPropertyList::serializeXML(STWValue(everyType()));
    EXPECT_FALSE(STWPropertyList::parse(""));
    EXPECT_FALSE(STWPropertyList::parse("not a plist at all"));
    EXPECT_FALSE(STWPropertyList::parse("bplist00"));
    for (size_t cut : {binary.size() / 2, binary.size() - 1, size_t(9)})
        EXPECT_FALSE(STWPropertyList::parse(binary.substr(0, cut))) << cut;
    EXPECT_FALSE(STWPropertyList::parse(xml.substr(0, xml.size() / 2)));
    // A string (value or key) that is not UTF-8 or holds a NUL would not come back the same
    // from the next write of the file.
    for (bool inKey : {false, true}) {
        std::string patched = STWPropertyList::serializeBinary(STWValue(
            STWValue::Dictionary{{inKey ? "qqqq" : "k", STWValue(inKey ? "v" : "qqqq")}}));
        patched.replace(patched.find("qqqq"), 4, "\xffq\xfeq");
        EXPECT_FALSE(STWPropertyList::parse(patched)) << inKey;
    }
    std::string withNul = STWPropertyList::serializeXML(STWValue(STWValue::Dictionary{{"k", STWValue("aqqqqb")}}));
    withNul.replace(withNul.find("qqqq"), 4, std::string("\0\0\0\0", 4));
    EXPECT_FALSE(STWPropertyList::parse(withNul));
}

// An atomic write replaces the file whole or, failing (here no file may grow past 0 bytes
// while the new one is written), leaves the old one; no temporary file is left either way.
TEST_F(STWPropertyListFileTest, AtomicWritesReplaceTheFileOrLeaveItAndNoTemporary) {
    std::filesystem::path file = dir / "m.plist";
    STWErrorRef error;
    ASSERT_TRUE(STW_writeToURL(everyType(), file, STWWriteAtomic | STWWriteDurable, &error));
    STWValue::Dictionary second{{"only", STWValue(1)}};
    ASSERT_TRUE(STW_writeToURL(second, file, STWWriteAtomic, &error));

    signal(SIGXFSZ, SIG_IGN);
    rlimit original{};
    getrlimit(RLIMIT_FSIZE, &original);
    rlimit none{0, original.rlim_max};
    ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &none), 0);
    bool wrote = STW_writeToURL(everyType(), file, STWWriteAtomic, &error);
    setrlimit(RLIMIT_FSIZE, &original);
    EXPECT_FALSE(wrote);
    EXPECT_TRUE(error && error->isPOSIX(EFBIG)) << (error ? error->description() : "");

    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir), std::filesystem::directory_iterator()),
              1);
    auto back = STW_dictionaryWithContentsOfURL(file, STWReadDefault, &error);
    ASSERT_TRUE(back);
    EXPECT_EQ(*back, second);
}

TEST_F(STWPropertyListFileTest, ReadFailuresCarryTheirDomain) {
    std::ofstream(dir / "array.plist") << STWPropertyList::serializeXML(STWValue(STWValue::Array{}));
    std::ofstream(dir / "junk.plist") << "bplist00\x01\x02garbage";
    std::filesystem::create_symlink(dir / "array.plist", dir / "link.plist");
    struct Case {
        const char* name;
        unsigned options;
        std::string_view domain;
        int64_t code;
    } cases[] = {{"missing.plist", STWReadDefault, STWPOSIXErrorDomain, ENOENT},
                 {"array.plist", STWReadDefault, STWGenericErrorDomain, 2048},
                 {"junk.plist", STWReadDefault, STWGenericErrorDomain, 2048},
                 {"link.plist", STWReadNoFollow, STWPOSIXErrorDomain, ELOOP}};
    for (const Case& c : cases) {
        STWErrorRef error;
        EXPECT_FALSE(STW_dictionaryWithContentsOfURL(dir / c.name, c.options, &error)) << c.name;
        ASSERT_TRUE(error) << c.name;
        EXPECT_EQ(error->domain(), c.domain) << c.name;
        EXPECT_EQ(error->code(), c.code) << c.name;
    }
}

TEST(STWPathStrings, DotDotComponentsAndFileSystemBytes) {
    for (const char* path : {"a/../b", "..", "/x/.."})
        EXPECT_TRUE(containsDotDotPathComponents(path)) << path;
    for (const char* path : {"a/..b", "a/b..", "./a/."})
        EXPECT_FALSE(containsDotDotPathComponents(path)) << path;

    EXPECT_EQ(stringWithFileSystemRepresentation("caf\xc3\xa9"), "caf\xc3\xa9");
    // Invalid, truncated, overlong ("/") and surrogate sequences.
    for (const char* bad : {"bad\xff", "\xc3", "\xc0\xaf", "\xed\xa0\x80"})
        EXPECT_FALSE(stringWithFileSystemRepresentation(bad)) << bad;
    EXPECT_FALSE(stringWithFileSystemRepresentation("a\0b", 3));
    EXPECT_EQ(stringWithFileSystemRepresentation("abc", 2), "ab");
}

} // namespace

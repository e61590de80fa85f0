#include "common/STWDictionaryUtilities.h"
#include "common/STWPropertyList.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sys/wait.h>
#include <unistd.h>

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
    void writeRaw(const std::filesystem::path& p, const std::string& bytes) {
        std::ofstream(p, std::ios::binary) << bytes;
    }
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
    // Binary files keep fractions of a second (to the microsecond); UUIDs are written as their string.
    STWUUID u = STWUUID::random();
    STWValue precise(STWValue::Dictionary{{"d", STWValue(STWDate{1700000000, 250000000})}, {"u", STWValue(u)}});
    EXPECT_EQ(STWPropertyList::parse(STWPropertyList::serializeBinary(precise)),
              STWValue(STWValue::Dictionary{{"d", STWValue(STWDate{1700000000, 250000000})}, {"u", STWValue(u.string())}}));
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
}

TEST_F(STWPropertyListFileTest, DictionaryFilesRoundTripAndAtomicWritesLeaveNoTemporaryFile) {
    std::filesystem::path file = dir / "m.plist";
    STWErrorRef error;
    ASSERT_TRUE(STW_writeToURL(everyType(), file, STWWriteAtomic | STWWriteDurable, &error));
    STWValue::Dictionary second{{"only", STWValue(1)}};
    ASSERT_TRUE(STW_writeToURL(second, file, STWWriteAtomic, &error));
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir), std::filesystem::directory_iterator()),
              1);
    auto back = STW_dictionaryWithContentsOfURL(file, STWReadDefault, &error);
    ASSERT_TRUE(back);
    EXPECT_EQ(*back, second);
}

TEST_F(STWPropertyListFileTest, ReadFailuresCarryTheirDomain) {
    writeRaw(dir / "array.plist", STWPropertyList::serializeXML(STWValue(STWValue::Array{STWValue(1)})));
    writeRaw(dir / "junk.plist", "bplist00\x01\x02garbage");
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

TEST_F(STWPropertyListFileTest, FailedWriteLeavesTheOldFileAndNoTemporary) {
    // A writer that may not create files in the directory: run as an unprivileged user
    // when we are root, else make the directory read-only.
    std::filesystem::path sub = dir / "sub";
    std::filesystem::create_directory(sub);
    ASSERT_TRUE(
        STW_writeToURL(STWValue::Dictionary{{"v", STWValue(1)}}, sub / "f.plist", STWWriteAtomic, nullptr));
    std::filesystem::permissions(dir, std::filesystem::perms(0755));
    std::filesystem::permissions(sub, std::filesystem::perms(0555));
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        if (geteuid() == 0 && (setresgid(65534, 65534, 65534) != 0 || setresuid(65534, 65534, 65534) != 0))
            _exit(3);
        STWErrorRef error;
        bool wrote =
            STW_writeToURL(STWValue::Dictionary{{"v", STWValue(2)}}, sub / "f.plist", STWWriteAtomic, &error);
        _exit(!wrote && error && error->isPOSIX(EACCES) ? 0 : 1);
    }
    int status = 0;
    waitpid(child, &status, 0);
    std::filesystem::permissions(sub, std::filesystem::perms::owner_all);
    ASSERT_TRUE(WIFEXITED(status));
    ASSERT_NE(WEXITSTATUS(status), 3) << "could not drop privileges";
    EXPECT_EQ(WEXITSTATUS(status), 0);
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(sub), std::filesystem::directory_iterator()),
              1);
    auto back = STW_dictionaryWithContentsOfURL(sub / "f.plist", STWReadDefault, nullptr);
    ASSERT_TRUE(back);
    EXPECT_EQ(*back->at("v").uint64Value(), 1u);
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

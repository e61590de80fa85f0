#include "common/STWFormat.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <memory>

namespace {

struct Thing {
    std::string name;
    std::string description() const { return "<Thing " + name + ">"; }
};

TEST(STWFormat, ObjectsPrintTheirDescriptionAndNullPrintsNull) {
    Thing thing{"a"};
    auto shared = std::make_shared<const Thing>(Thing{"b"});
    std::shared_ptr<const Thing> none;
    EXPECT_EQ(STWFormat("%@ / %@ / %@", thing, shared, none), "<Thing a> / <Thing b> / (null)");
    EXPECT_EQ(
        STWFormat("Invalid metadata UUID: %@ at %@", std::string("XYZ"), std::filesystem::path("/c/m.plist")),
        "Invalid metadata UUID: XYZ at /c/m.plist");
}

TEST(STWFormat, IntegerConversionsFollowTheirLengthModifiers) {
    EXPECT_EQ(STWFormat("command=%llu, error=%llu", uint64_t(18446744073709551615ull), uint64_t(49)),
              "command=18446744073709551615, error=49");
    // A command of 2^63 printed through %lld reads as negative, as the system's own log does.
    EXPECT_EQ(STWFormat("Invalid command index: %lld", uint64_t(1) << 63),
              "Invalid command index: -9223372036854775808");
    EXPECT_EQ(STWFormat("%d|%u|%ld|%x|%5d|%-4d|", -1, -1, int64_t(-5), 255u, 42, 7),
              "-1|4294967295|-5|ff|   42|7   |");
    EXPECT_EQ(STWFormat("%@", -12), "-12");
}

TEST(STWFormat, MismatchedAndMissingArgumentsNeverReadGarbage) {
    EXPECT_EQ(STWFormat("%d and %s", "text", 5), "text and 5");
    EXPECT_EQ(STWFormat("%@ %@", 1), "1 (missing)");
    EXPECT_EQ(STWFormat("100%% done %q %", 1), "100% done %q %");
    EXPECT_EQ(STWFormat("%s", static_cast<const char*>(nullptr)), "(null)");
    EXPECT_EQ(STWFormat(" command=%{public, signpost.description:attribute}llu ", 3u), " command=3 ");
}

} // namespace

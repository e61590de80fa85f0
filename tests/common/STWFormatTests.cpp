#include "common/STWFormat.h"

#include <gtest/gtest.h>

#include <memory>

namespace {

struct Thing {
    std::string name;
    std::string description() const { return "<Thing " + name + ">"; }
};

// %@ prints an object's description, length modifiers are honoured, and arguments that do
// not fit their conversion, or are missing, never read garbage.
TEST(STWFormat, ConversionsAndArgumentsThatDoNotFitThem) {
    std::shared_ptr<const Thing> none;
    EXPECT_EQ(STWFormat("%@ / %@ / %@", Thing{"a"}, std::make_shared<const Thing>(Thing{"b"}), none),
              "<Thing a> / <Thing b> / (null)");
    EXPECT_EQ(STWFormat("%llu|%u|%ld|%@", UINT64_MAX, -1, int64_t(-5), -12),
              "18446744073709551615|4294967295|-5|-12");
    // A command of 2^63 printed through %lld reads as negative, as the system's own log does.
    EXPECT_EQ(STWFormat("Invalid command index: %lld", uint64_t(1) << 63),
              "Invalid command index: -9223372036854775808");
    EXPECT_EQ(STWFormat("%d and %s", "text", 5), "text and 5");
    EXPECT_EQ(STWFormat("%@ %@", 1), "1 (missing)");
    EXPECT_EQ(STWFormat("100%% done %q %", 1), "100% done %q %");
    EXPECT_EQ(STWFormat("%s", static_cast<const char*>(nullptr)), "(null)");
    EXPECT_EQ(STWFormat(" command=%{public, signpost.description:attribute}llu ", 3u), " command=3 ");
}

} // namespace

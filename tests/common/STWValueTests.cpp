#include "common/STWValue.h"

#include <gtest/gtest.h>

#include <limits>
#include <unordered_set>

namespace {

STWValue sample() {
    STWValue::Dictionary inner{{"k", STWValue(int64_t(-7))}, {"d", STWValue(STWData{0, 1, 255})}};
    return STWValue(STWValue::Dictionary{
        {"str", STWValue("x")},
        {"n", STWValue(5)},
        {"arr", STWValue(STWValue::Array{STWValue(true), STWValue(1.5), STWValue(inner)})},
    });
}

// Integers out of a reader's range, and values of another type, read as absent.
TEST(STWValue, TypedReadsOfTheWrongTypeReadAsAbsent) {
    STWValue five(5), minus(-1), big(uint64_t(1) << 63), text("5");
    EXPECT_FALSE(minus.uint64Value());
    EXPECT_FALSE(big.int64Value());
    EXPECT_EQ(big.uint64Value(), uint64_t(1) << 63);
    for (const STWValue& other : {text, STWValue(true), STWValue(5.0)})
        EXPECT_FALSE(other.uint64Value()) << other.description();
    EXPECT_FALSE(five.boolValue());
    EXPECT_EQ(five.realValue(), 5.0); // integers serve where seconds are read
    EXPECT_EQ(five.string(), nullptr);
    EXPECT_EQ(text.find("str"), nullptr);
}

TEST(STWValue, EqualityAndHashAreDeepAndCopiesAreIndependent) {
    STWValue a = sample(), b = sample();
    EXPECT_EQ(a, b);
    EXPECT_EQ(a.hash(), b.hash());
    STWValue c = a;
    (*c.mutableDictionary())["arr"].mutableArray()->push_back(STWValue("more"));
    EXPECT_NE(a, c);
    EXPECT_EQ(a, b); // the copy did not share storage with a
    // Signed and unsigned spellings of one integer are one value.
    EXPECT_EQ(STWValue(int64_t(3)), STWValue(uint64_t(3)));
    EXPECT_EQ(STWValue(int64_t(3)).hash(), STWValue(uint64_t(3)).hash());
    EXPECT_NE(STWValue(3), STWValue(3.0));
    std::unordered_set<STWValue> set{a, b, c, STWValue(), STWValue("x")};
    EXPECT_EQ(set.size(), 4u);
}

TEST(STWValue, IdenticalComparesRealsBitForBit) {
    auto nested = [](double real) {
        return STWValue(
            STWValue::Dictionary{{"a", STWValue(STWValue::Array{STWValue("x"), STWValue(real)})}});
    };
    double nan = std::numeric_limits<double>::quiet_NaN();
    EXPECT_NE(nested(nan), nested(nan));
    EXPECT_TRUE(nested(nan).isIdenticalTo(nested(nan)));
    EXPECT_EQ(nested(0.0), nested(-0.0));
    EXPECT_FALSE(nested(0.0).isIdenticalTo(nested(-0.0)));
    EXPECT_TRUE(sample().isIdenticalTo(sample()));
    STWValue other = sample();
    (*other.mutableDictionary())["n"] = STWValue(6);
    EXPECT_FALSE(sample().isIdenticalTo(other));
}

} // namespace

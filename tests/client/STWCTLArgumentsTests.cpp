#include "client/stowlyctl/STWCTLArguments.h"
#include "client/stowlyctl/STWCTLOutput.h"
#include "common/STWValue.h"
#include "tests/client/STWFakeDaemon.h"

#include <gtest/gtest.h>

#include <cmath>

namespace {

std::optional<STWValue> parse(const char* argument) {
    std::string reason;
    auto parsed = STWCTLParseTypedArgument(argument, &reason);
    if (!parsed)
        return std::nullopt;
    return parsed->second;
}

} // namespace

TEST(STWCTLArguments, NumbersAreStrict) {
    EXPECT_EQ(STWCTLParseUInt64("18446744073709551615"), UINT64_MAX);
    EXPECT_EQ(STWCTLParseUInt64("0"), 0u);
    for (const char* bad : {"18446744073709551616", "-1", "+1", " 1", "1 ", "0x10", "", "1e3"})
        EXPECT_FALSE(STWCTLParseUInt64(bad)) << bad;
    EXPECT_EQ(STWCTLParseInt64("-9223372036854775808"), INT64_MIN);
    for (const char* bad : {"9223372036854775808", "-", "--1", "+5", "-9223372036854775809"})
        EXPECT_FALSE(STWCTLParseInt64(bad)) << bad;
}

TEST(STWCTLArguments, TypedValues) {
    EXPECT_EQ(parse("K=str:a=b:c"), STWValue("a=b:c")); // only the first '=' and ':' separate
    EXPECT_EQ(parse("K=str:"), STWValue(""));
    EXPECT_EQ(parse("K=u64:18446744073709551615"), STWValue(UINT64_MAX));
    EXPECT_EQ(parse("K=i64:-7"), STWValue(-7));
    EXPECT_EQ(parse("K=bool:yes"), STWValue(true));
    EXPECT_EQ(parse("K=bool:0"), STWValue(false));
    EXPECT_EQ(parse("K=real:-2.5e3"), STWValue(-2500.0));
    EXPECT_EQ(parse("K=uuid:01234567-89ab-cdef-0123-456789ABCDEF"),
              STWValue(*STWUUID::fromString("01234567-89AB-CDEF-0123-456789ABCDEF")));
    EXPECT_EQ(parse("K=data:00fFa0"), STWValue(STWData{0x00, 0xff, 0xa0}));
    EXPECT_EQ(parse("K=data:"), STWValue(STWData{}));
    EXPECT_EQ(parse("K=strarr:a,,b"), STWValue(STWValue::Array{STWValue("a"), STWValue(""), STWValue("b")}));
    EXPECT_EQ(parse("K=strarr:"), STWValue(STWValue::Array{}));
    EXPECT_EQ(parse("K=u64arr:1,18446744073709551615"),
              STWValue(STWValue::Array{STWValue(1), STWValue(UINT64_MAX)}));

    for (const char* bad :
         {"K", "K=str", "=str:x", "K=u64:-1", "K=u64:1.5", "K=i64:1x", "K=bool:maybe", "K=real:", "K=real: 1",
          "K=real:1x", "K=uuid:0123", "K=data:abc", "K=data:zz", "K=u64arr:1,,2", "K=u64arr:1,x",
          "K=text:hello", "K=str:\xc3\x28", "K=plist:/nonexistent/file.plist"})
        EXPECT_FALSE(parse(bad)) << bad;
}

TEST(STWCTLOutput, JSONOfEveryType) {
    STWValue::Dictionary reply{
        {"ReplyError", STWValue(1)},
        {"Big", STWValue(UINT64_MAX)},
        {"Negative", STWValue(-3)},
        {"Real", STWValue(0.1)},
        {"NotANumber", STWValue(std::nan(""))},
        {"Text", STWValue("quote\" back\\ tab\t ctl\x01 \xc3\xa9")},
        {"Data", STWValue(STWData{'f', 'o', 'o', 'b'})},
        {"Date", STWValue(STWDate{1700000000, 250000000})},
        {"UUID", STWValue(*STWUUID::fromString("01234567-89AB-CDEF-0123-456789ABCDEF"))},
        {"List", STWValue(STWValue::Array{STWValue(), STWValue(true), STWValue(STWValue::Dictionary{})})},
    };
    EXPECT_EQ(STWCTLReplyJSON(reply),
              "{\"Big\":18446744073709551615,\"Data\":\"Zm9vYg==\",\"Date\":\"2023-11-14T22:13:20.25Z\","
              "\"List\":[null,true,{}],\"Negative\":-3,\"NotANumber\":null,\"Real\":0.1,\"ReplyError\":1,"
              "\"Text\":\"quote\\\" back\\\\ tab\\t ctl\\u0001 \xc3\xa9\","
              "\"UUID\":\"01234567-89AB-CDEF-0123-456789ABCDEF\"}");
    for (auto [data, text] : std::vector<std::pair<STWData, const char*>>{
             {{}, ""}, {{'f'}, "Zg=="}, {{'f', 'o'}, "Zm8="}, {{'f', 'o', 'o'}, "Zm9v"}})
        EXPECT_EQ(STWCTLBase64(data), text);
}

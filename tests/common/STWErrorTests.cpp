#include "common/STWError.h"

#include <gtest/gtest.h>

#include <cerrno>

namespace {

TEST(STWError, CarriesCodeMessageSiteAndUnderlyingError) {
    int posixLine = __LINE__ + 1;
    STWErrorRef posix = STW_POSIX_ERROR_NOLOG(ENOENT, "Could not open %@", std::string("/x"));
    // One line per call: compilers disagree on the __LINE__ of a macro call spread over several.
    const char* format = "Failed to write metadata dictionary to URL %@ : %@:%ld";
    int line = __LINE__ + 1;
    STWErrorRef error = STW_ERROR_NOLOG(34, posix, format, std::string("/t"), posix->domain(), posix->code());
    EXPECT_EQ(error->domain(), STWErrorDomain);
    EXPECT_EQ(error->code(), 34);
    EXPECT_TRUE(error->is(STWErrorWriteFileFailed));
    EXPECT_FALSE(error->is(STWErrorReadFileFailed));
    EXPECT_EQ(error->message(), "Failed to write metadata dictionary to URL /t : STWPOSIXErrorDomain:2");
    EXPECT_EQ(error->functionName(), "TestBody");
    EXPECT_EQ(error->sourceFileLine(), static_cast<uint64_t>(line));
    ASSERT_EQ(error->underlyingError(), posix);
    EXPECT_TRUE(posix->isPOSIX(ENOENT));
    EXPECT_EQ(error->description(), "Error Domain=STWErrorDomain Code=34 \"Failed to write metadata "
                                    "dictionary to URL /t : STWPOSIXErrorDomain:2\" "
                                    "{FunctionName=TestBody, SourceFileLine=" +
                                        std::to_string(line) +
                                        ", UnderlyingError=Error Domain=STWPOSIXErrorDomain Code=2 \"Could "
                                        "not open /x\" {FunctionName=TestBody, "
                                        "SourceFileLine=" +
                                        std::to_string(posixLine) + ", Reason=No such file or directory}}");
}

TEST(STWError, EveryCodeOfTheTableHasAName) {
    const uint64_t codes[] = {1,  4,  5,  6,  7,  8,  9,  10, 11, 12, 14, 15, 17, 18, 20, 21, 22,
                              23, 24, 27, 28, 29, 33, 34, 35, 36, 38, 40, 41, 43, 44, 45, 46, 47,
                              48, 49, 55, 60, 61, 62, 63, 64, 66, 67, 68, 69, 71, 73, 75, 76, 77};
    for (uint64_t code : codes)
        EXPECT_NE(STWErrorCodeName(code), nullptr) << code;
    EXPECT_STREQ(STWErrorCodeName(55), "NotEntitled");
    EXPECT_STREQ(STWErrorCodeName(49), "UnsupportedCommand");
    EXPECT_EQ(STWErrorCodeName(2), nullptr);
}

} // namespace

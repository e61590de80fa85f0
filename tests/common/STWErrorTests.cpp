#include "common/STWError.h"

#include <gtest/gtest.h>

#include <cerrno>

namespace {

TEST(STWError, CarriesCodeMessageSiteAndUnderlyingError) {
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
    EXPECT_NE(error->description().find("Code=34"), std::string::npos) << error->description();
}

} // namespace

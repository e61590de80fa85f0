#include "common/STWLog.h"

#include "common/STWError.h"
#include "common/STWFileIO.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstdlib>
#include <filesystem>

namespace {

class STWLogFileTest : public ::testing::Test {
protected:
    void SetUp() override {
        char templ[] = "/tmp/stowly-log-XXXXXX";
        ASSERT_NE(mkdtemp(templ), nullptr);
        dir = templ;
        STWLog::setSystemLogLevel(STWLogLevel::Fault);
    }
    void TearDown() override {
        STWLog::closeLogFile();
        STWLog::setSystemLogLevel(STWLogLevel::Info);
        std::filesystem::remove_all(dir);
    }
    std::string contents(const std::filesystem::path& p) {
        STWLog::flush();
        std::string text;
        EXPECT_EQ(STWReadFileContents(p, &text), 0);
        return text;
    }
    std::filesystem::path dir;
};

TEST_F(STWLogFileTest, FileTakesOnlyTheLevelsItAdmitsAndTagsEachLine) {
    std::filesystem::path file = dir / "stowlyd.log";
    ASSERT_TRUE(STWLog::openLogFile(file, "com.vorlane.stowlyd", STWLogLevel::Notice));
    STW_LOG_NOTICE(STWLogCategory::Startup, "before writing is enabled");
    STWLog::enableFileWriting(1, 102400);
    STW_LOG_ERROR(STWLogCategory::Cache, "error %d", 3);
    STW_LOG_NOTICE(STWLogCategory::Tolvan, "notice %@", std::string("five"));
    STW_LOG_DEBUG(STWLogCategory::Cache, "debug line");
    STW_LOG_FN("stowlyd_init", STWLogLevel::Notice, STWLogCategory::Startup, "named");

    std::string text = contents(file);
    EXPECT_EQ(text.find("before writing"), std::string::npos);
    EXPECT_NE(text.find("<Error> [cache] TestBody: error 3"), std::string::npos) << text;
    EXPECT_NE(text.find("<Notice> [tolvan] TestBody: notice five"), std::string::npos) << text;
    EXPECT_NE(text.find("[startup] stowlyd_init: named"), std::string::npos) << text;
    EXPECT_EQ(text.find("debug line"), std::string::npos);
}

TEST_F(STWLogFileTest, FileRotatesAtItsSizeAndKeepsTheDiskLevelOfOldFiles) {
    std::filesystem::path file = dir / "stowlyd.log";
    ASSERT_TRUE(STWLog::openLogFile(file, "com.vorlane.stowlyd", STWLogLevel::Notice));
    STWLog::enableFileWriting(1, 4096);
    for (int i = 0; i < 400; ++i)
        STW_LOG_NOTICE(STWLogCategory::Test, "line %d of a log that is long enough to rotate", i);
    STWLog::flush();
    EXPECT_LE(std::filesystem::file_size(file), 4096u);
    EXPECT_TRUE(std::filesystem::exists(dir / "stowlyd.1.log"));
    EXPECT_FALSE(std::filesystem::exists(dir / "stowlyd.2.log"));
}

// What `journalctl FIELD=value` finds an entry by: the call's site, or the site and code
// of the error it reports.
TEST(STWLogJournal, EntriesCarryTheirSiteAndTheCodeOfTheirError) {
    using Fields = std::vector<std::string>;
    EXPECT_EQ(STWLog::journalFields(STWLogLevel::Error, STWLogCategory::Cache,
                                    {"rebuild", "common/x.cpp", 12}, "gone", nullptr),
              (Fields{"MESSAGE=rebuild: gone", "PRIORITY=3", "SYSLOG_IDENTIFIER=stowlyd",
                      "STOWLY_SUBSYSTEM=com.vorlane.stowly", "STOWLY_CATEGORY=cache", "CODE_FUNC=rebuild",
                      "CODE_FILE=common/x.cpp", "CODE_LINE=12"}));

    // The file as the tree names it, wherever it was built.
    Fields here =
        STWLog::journalFields(STWLogLevel::Debug, STWLogCategory::Test, {"f", __FILE__, 1}, "m", nullptr);
    EXPECT_EQ(here[6], "CODE_FILE=tests/common/STWLogTests.cpp");

    // An error takes its message, underlying error and site where it is made; one line per
    // call, since compilers disagree on the __LINE__ of a macro call spread over several.
    STWErrorRef posix = STW_POSIX_ERROR_NOLOG(ENOENT, "open");
    int line = __LINE__ + 1;
    STWErrorRef notFound = STW_ERROR_NOLOG(STWErrorNotFound, posix, "no container %@", std::string("c"));
    EXPECT_EQ(notFound->message(), "no container c");
    EXPECT_EQ(notFound->underlyingError(), posix);
    Fields fields = STWLog::journalFields(STWLogLevel::Notice, STWLogCategory::Tolvan,
                                          {"caller", "y.cpp", 40}, "failed", notFound.get());
    Fields tail(fields.end() - 3, fields.end());
    EXPECT_EQ(tail,
              (Fields{"CODE_FUNC=TestBody", "CODE_LINE=" + std::to_string(line), "STOWLY_RESULT_CODE=21"}));
    EXPECT_EQ(fields.size(), 8u); // no CODE_FILE of the caller beside the error's line
    // A call's own fields follow, with an error or without one.
    const std::string more[] = {"STOWLY_COMMAND=4"};
    EXPECT_EQ(STWLog::journalFields(STWLogLevel::Notice, STWLogCategory::Tolvan, {"caller", "y.cpp", 40}, "failed",
                                    notFound.get(), more),
              [&] { Fields all = fields; all.push_back(more[0]); return all; }());
    EXPECT_EQ(STWLog::journalFields(STWLogLevel::Debug, STWLogCategory::Test, {"f", "", 0}, "m", nullptr, more).back(),
              more[0]);
    EXPECT_EQ(
        STWLog::journalFields(STWLogLevel::Error, STWLogCategory::FS, {"f", "", 0}, "m", posix.get()).back(),
        "ERRNO=2");

    // The facade finds the error among the formatted arguments in each form it is passed.
    EXPECT_EQ(STWFormatArg(*notFound).error(), notFound.get());
    EXPECT_EQ(STWFormatArg(notFound).error(), notFound.get());
    EXPECT_EQ(STWFormatArg(posix.get()).error(), posix.get());
    EXPECT_EQ(STWFormatArg(std::string("other")).error(), nullptr);
    EXPECT_EQ(STWFormatArg(STWErrorRef()).error(), nullptr);
}

TEST(STWLogDeathTest, FatalStopsTheProcessWithItsMessage) {
    EXPECT_DEATH(STW_FATAL("Can't create dispatch queues."), "Can't create dispatch queues\\.");
}

} // namespace

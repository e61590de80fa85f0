#include "common/STWLog.h"

#include "common/STWFileIO.h"

#include <gtest/gtest.h>

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

TEST_F(STWLogFileTest, UnwritableLogPathIsReported) {
    EXPECT_FALSE(
        STWLog::openLogFile(dir / "missing" / "stowlyd.log", "com.vorlane.stowlyd", STWLogLevel::Notice));
    EXPECT_FALSE(STWLog::fileIsOpen());
}

TEST(STWLogDeathTest, FatalStopsTheProcessWithItsMessage) {
    EXPECT_DEATH(STW_FATAL("Can't create dispatch queues."), "Can't create dispatch queues\\.");
}

} // namespace

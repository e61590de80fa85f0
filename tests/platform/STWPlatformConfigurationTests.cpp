#include "platform/STWPlatformConfiguration.h"

#include "common/STWDictionaryUtilities.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>

namespace {

class STWPlatformConfigurationTest : public ::testing::Test {
protected:
    void SetUp() override {
        char templ[] = "/tmp/stowly-root-XXXXXX";
        ASSERT_NE(mkdtemp(templ), nullptr);
        root = templ;
        std::filesystem::create_directories(root / "etc/stowly");
    }
    void TearDown() override { std::filesystem::remove_all(root); }
    void writeSettings(const STWValue::Dictionary& settings) {
        ASSERT_TRUE(STW_writeToURL(settings, root / "etc/stowly/stowlyd.plist", STWWriteAtomic, nullptr));
    }
    std::filesystem::path root;
};

// The keys that change what the daemon does (developer mode, internal image, owners, the
// mobile user's name, personas) are each exercised where they matter; here the rest.
TEST_F(STWPlatformConfigurationTest, MissingFileMeansDefaultsAndTheSystemVersionComesFromOSRelease) {
    STWErrorRef error;
    auto defaults = STWPlatformConfiguration::loadFromRoot(root, &error);
    ASSERT_TRUE(defaults) << error->description();
    EXPECT_EQ(defaults->resolve("/private/var/containers"), root / "private/var/containers");
    EXPECT_EQ(STWPlatformConfiguration("/").resolve("/private/var"), "/private/var");
    EXPECT_FALSE(defaults->isMultiUser() || defaults->isFeatureEnabled("fast_container_sizing"));

    writeSettings({{"MultiUser", STWValue(true)},
                   {"Features", STWValue(STWValue::Dictionary{{"fast_container_sizing", STWValue(true)}})}});
    std::ofstream(root / "etc/os-release")
        << "NAME=\"Stowly OS\"\nBUILD_ID=21A100\nVERSION_ID=\"17.\\\"1\\\"\"\n"
           "# comment\n=novalue\nbroken\nRELEASE_TYPE='Internal'\n";
    auto set = STWPlatformConfiguration::loadFromRoot(root, &error);
    ASSERT_TRUE(set);
    EXPECT_TRUE(set->isMultiUser() && set->isFeatureEnabled("fast_container_sizing"));
    const auto& version = set->systemVersion();
    EXPECT_EQ(*STWDictionaryString(version, "BuildVersion"), "21A100");
    EXPECT_EQ(*STWDictionaryString(version, "ProductVersion"), "17.\"1\"");
    EXPECT_EQ(*STWDictionaryString(version, "ReleaseType"), "Internal");
}

TEST_F(STWPlatformConfigurationTest, MalformedFilesAndWrongTypesAreRefusedWithThePath) {
    std::ofstream(root / "etc/stowly/stowlyd.plist") << "<plist><dict><key>InternalImage</key>";
    STWErrorRef error;
    EXPECT_FALSE(STWPlatformConfiguration::loadFromRoot(root, &error));
    ASSERT_TRUE(error);
    EXPECT_NE(error->message().find((root / "etc/stowly/stowlyd.plist").string()), std::string::npos)
        << error->message();

    for (const auto& [key, value, text] : std::vector<std::tuple<const char*, STWValue, const char*>>{
             {"InternalImage", STWValue("yes"), "InternalImage must be a boolean"},
             {"InstallationUID", STWValue(-1), "InstallationUID must be a user id"},
             {"Features", STWValue(1), "Features must be a dictionary"},
             {"MaxConnections", STWValue(0), "MaxConnections must be a positive integer"},
             {"FrameTimeout", STWValue("10"), "FrameTimeout must be a positive number of seconds"}}) {
        writeSettings({{key, value}});
        error.reset();
        EXPECT_FALSE(STWPlatformConfiguration::loadFromRoot(root, &error)) << key;
        ASSERT_TRUE(error);
        EXPECT_NE(error->message().find(text), std::string::npos) << error->message();
    }

    error.reset();
    EXPECT_FALSE(STWPlatformConfiguration::loadFromRoot(root / "nonexistent", &error));
    ASSERT_TRUE(error);
}

} // namespace

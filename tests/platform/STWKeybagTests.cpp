#include "platform/STWKeybag.h"

#include "common/STWFileIO.h"
#include "platform/STWPlatformConfiguration.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>

// The state is kept between calls; every way the file can change (a rename over it, a
// write in place, its removal, the runtime directory made anew) shows at the very next call.
TEST(STWKeybag, TheStateFollowsEveryChangeOfTheFileAtOnce) {
    char templ[] = "/tmp/stowly-keybag-XXXXXX";
    ASSERT_NE(mkdtemp(templ), nullptr);
    std::filesystem::path root = templ, run = root / "run/stowly";
    std::filesystem::create_directories(run);
    auto configuration = STWPlatformConfiguration::loadFromRoot(root, nullptr);
    ASSERT_TRUE(configuration);
    STWPlatformConfiguration::setSharedInstance(configuration);

    EXPECT_FALSE(STWKeybag::isDeviceLocked());
    ASSERT_EQ(STWWriteFileAtomically(run / "keybag", "locked\n", 0644, false), 0);
    EXPECT_TRUE(STWKeybag::isDeviceLocked());
    EXPECT_TRUE(STWKeybag::isDeviceLocked());
    std::ofstream(run / "keybag", std::ios::trunc) << "unlocked";
    EXPECT_FALSE(STWKeybag::isDeviceLocked());
    std::ofstream(run / "keybag", std::ios::trunc) << "locked";
    EXPECT_TRUE(STWKeybag::isDeviceLocked());
    std::filesystem::remove(run / "keybag");
    EXPECT_FALSE(STWKeybag::isDeviceLocked());

    std::filesystem::remove_all(run);
    std::filesystem::create_directories(run);
    EXPECT_FALSE(STWKeybag::isDeviceLocked());
    std::ofstream(run / "keybag") << "locked";
    EXPECT_TRUE(STWKeybag::isDeviceLocked());
    std::filesystem::remove_all(root);
}

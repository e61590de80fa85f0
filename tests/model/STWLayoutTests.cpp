#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <sys/stat.h>

namespace {

class STWLayoutTest : public ::testing::Test {
protected:
    void SetUp() override {
        root = &STWTestRoot::shared();
        global = STWGlobalConfiguration::sharedInstance();
        mobile = STWUserIdentityCache::defaultUserIdentity();
    }
    static struct stat statOf(const std::filesystem::path& p) {
        struct stat st {};
        EXPECT_EQ(lstat(p.c_str(), &st), 0) << p;
        return st;
    }
    STWTestRoot* root;
    std::shared_ptr<STWGlobalConfiguration> global;
    STWUserIdentityRef mobile;
};

TEST_F(STWLayoutTest, EveryPathLivesUnderTheRootAndIsCreated) {
    EXPECT_EQ(global->currentMobileUserId(), 501u);
    EXPECT_EQ(global->stagingDirectory(), root->resolve("/private/var/root/Library/Caches/com.vorlane.stowlyd/Staging"));
    EXPECT_EQ(global->deathrowDirectory(), root->resolve("/private/var/root/Library/Caches/com.vorlane.stowlyd/Dead"));
    EXPECT_EQ(global->replaceDirectory(), root->resolve("/private/var/root/Library/Stowly/Replace"));
    EXPECT_EQ(global->logDirectory(), root->resolve("/private/var/root/Library/Logs/Stowly"));
    EXPECT_EQ(*global->containerDirectoryURLForUserIdentity(mobile, 12, false), root->resolve("/private/var/containers/Data/System"));
    EXPECT_EQ(*global->containerDirectoryURLForUserIdentity(mobile, 13, true),
              root->resolve("/private/var/root/Library/Caches/com.vorlane.stowlyd/Temp/Shared/SystemGroup"));
    EXPECT_EQ(*global->containerDirectoryURLForUserIdentity(mobile, 1, true), root->resolve("/private/var/containers/Temp/Bundle/Application"));
    EXPECT_EQ(*global->containerDirectoryURLForUserIdentity(mobile, 9, false),
              root->resolve("/private/var/mobile/Containers/Data/TolvanService"));
    EXPECT_EQ(*global->containerDirectoryURLForUserIdentity(mobile, 7, true), root->resolve("/private/var/mobile/Containers/Temp/Shared/AppGroup"));
    EXPECT_EQ(global->stagingDirectoryURLForUserIdentity(mobile, 2), root->resolve("/private/var/mobile/Containers/Staging"));
    EXPECT_EQ(global->stagingDirectoryURLForUserIdentity(mobile, 12), global->stagingDirectory());

    struct stat bundle = statOf(root->resolve("/private/var/containers/Temp/Bundle/Application"));
    EXPECT_TRUE(S_ISDIR(bundle.st_mode));
    EXPECT_EQ(bundle.st_mode & 07777, 0755u);
    EXPECT_EQ(bundle.st_uid, 33u);
    EXPECT_EQ(bundle.st_gid, 33u);
    EXPECT_EQ(statOf(root->resolve("/private/var/mobile/Containers/Data/TolvanService")).st_uid, 501u);
}

TEST_F(STWLayoutTest, PerUserConfigurationRefusesOtherClassesAndIsSharedByEqualIdentities) {
    auto perUser = global->getPerUserConfigurationForUserIdentity(mobile);
    for (STWContainerClass c : {0ull, 1ull, 12ull, 14ull, 99ull})
        EXPECT_FALSE(perUser->containerDirectoryURLForContentClass(c, false)) << c;
    EXPECT_FALSE(global->containerDirectoryURLForUserIdentity(mobile, 0, false));
    EXPECT_FALSE(global->containerDirectoryURLForUserIdentity(mobile, 14, false));
    auto unspecific = STWUserIdentity::initWithUID(501, 501, mobile->homeDirectoryURL(), std::nullopt, STWPersonaTypeUnspecific, 501);
    EXPECT_EQ(global->getPerUserConfigurationForUserIdentity(unspecific), perUser);
    EXPECT_FALSE(global->legacyTransientBundleDirectory());
}

TEST_F(STWLayoutTest, ARemovedBaseDirectoryIsRepairedByTheNextCall) {
    std::filesystem::path staging = global->stagingDirectory();
    std::filesystem::remove_all(root->resolve("/private/var/root/Library/Caches"));
    EXPECT_FALSE(std::filesystem::exists(staging));
    EXPECT_EQ(global->stagingDirectory(), staging);
    EXPECT_TRUE(std::filesystem::is_directory(staging));
}

} // namespace

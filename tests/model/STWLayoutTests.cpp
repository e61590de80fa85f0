#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

namespace {

class STWLayoutTest : public ::testing::Test {
protected:
    void SetUp() override {
        root = &STWTestRoot::shared();
        global = STWGlobalConfiguration::sharedInstance();
        mobile = STWUserIdentityCache::defaultUserIdentity();
    }
    static int32_t protectionClassOf(const std::filesystem::path& p) {
        int32_t dataProtectionClass = -1;
        EXPECT_TRUE(STWFileManager::defaultManager()->dataProtectionClassOfItemAtURL(p, &dataProtectionClass)) << p;
        return dataProtectionClass;
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
    for (const std::filesystem::path& path :
         {global->stagingDirectory(), global->deathrowDirectory(), global->replaceDirectory(), global->logDirectory(),
          *global->containerDirectoryURLForUserIdentity(mobile, 12, false),
          *global->containerDirectoryURLForUserIdentity(mobile, 13, true),
          *global->containerDirectoryURLForUserIdentity(mobile, 9, false),
          *global->containerDirectoryURLForUserIdentity(mobile, 7, true)}) {
        EXPECT_TRUE(path.native().starts_with(root->resolve("/private/var/").native())) << path;
        EXPECT_TRUE(std::filesystem::is_directory(path)) << path;
    }
    // Staging shares a file system with the class directories it publishes into.
    EXPECT_EQ(global->stagingDirectoryURLForUserIdentity(mobile, 2), root->resolve("/private/var/mobile/Containers/Staging"));
    EXPECT_EQ(global->stagingDirectoryURLForUserIdentity(mobile, 12), global->stagingDirectory());

    struct stat bundle = statOf(*global->containerDirectoryURLForUserIdentity(mobile, 1, true));
    EXPECT_EQ(bundle.st_mode & 07777, 0755u);
    EXPECT_EQ(bundle.st_uid, 33u);
    EXPECT_EQ(bundle.st_gid, 33u);
    EXPECT_EQ(statOf(*global->containerDirectoryURLForUserIdentity(mobile, 9, false)).st_uid, 501u);
}

// A directory made once and changed behind the daemon's back is made again, never followed:
// removed with its parent, a link in its place or on the way, another owner, death row removed.
TEST_F(STWLayoutTest, ADirectoryReplacedAfterItWasMadeIsMadeAgainNotFollowed) {
    namespace fs = std::filesystem;
    fs::path staging = global->stagingDirectory();
    fs::remove_all(root->resolve("/private/var/root/Library/Caches"));
    EXPECT_EQ(global->stagingDirectory(), staging);
    EXPECT_TRUE(fs::is_directory(staging));

    fs::path home = root->resolve("/private/var/relinked-layout"), outside = root->resolve("/private/var/outside");
    auto user = STWUserIdentity::initWithUID(503, 503, home, "RELINKED", STWPersonaTypeEnterprise, 2001);
    fs::path classDirectory = *global->containerDirectoryURLForUserIdentity(user, 2, false);
    fs::create_directories(outside);
    fs::rename(classDirectory, outside / "Application");
    fs::create_directory_symlink(outside / "Application", classDirectory);
    EXPECT_EQ(*global->containerDirectoryURLForUserIdentity(user, 2, false), classDirectory);
    EXPECT_TRUE(fs::is_directory(fs::symlink_status(classDirectory)));
    EXPECT_TRUE(fs::is_directory(fs::symlink_status(outside / "Application"))) << "nothing was followed";

    fs::rename(home / "Containers/Data", home / "Containers/Moved");
    fs::create_directory_symlink(home / "Containers/Moved", home / "Containers/Data");
    global->containerDirectoryURLForUserIdentity(user, 2, false);
    EXPECT_TRUE(fs::is_directory(fs::symlink_status(home / "Containers/Data")));

    ASSERT_EQ(chown(classDirectory.c_str(), 0, 0), 0);
    global->containerDirectoryURLForUserIdentity(user, 2, false);
    EXPECT_EQ(statOf(classDirectory).st_uid, 503u);

    auto deathRow = global->openDeathrowDirectory();
    ASSERT_TRUE(deathRow);
    fs::remove_all(deathRow->url);
    deathRow = global->openDeathrowDirectory();
    struct stat held {};
    ASSERT_EQ(fstat(deathRow->fd.get(), &held), 0);
    EXPECT_EQ(held.st_ino, statOf(deathRow->url).st_ino) << "reopened where the path now leads";
    fs::remove_all(home);
    fs::remove_all(outside);
}

TEST_F(STWLayoutTest, StateDirectoriesCarryNoProtectionClassAndBackupsAreNeverCreated) {
    EXPECT_EQ(protectionClassOf(global->cachesDirectory()), 4);
    EXPECT_EQ(protectionClassOf(global->libraryDirectory()), 4);
    EXPECT_EQ(protectionClassOf(global->logDirectory()), 4);
    // The children inherit nothing: only the two bases are given a class.
    EXPECT_EQ(protectionClassOf(global->stagingDirectory()), 0);

    // An enterprise identity with a home of its own gets its per-user tree there.
    std::filesystem::path home = root->resolve("/private/var/enterprise-layout");
    auto enterprise = STWUserIdentity::initWithUID(502, 502, home, "ENT-LAYOUT", STWPersonaTypeEnterprise, 2000);
    auto perUser = global->getPerUserConfigurationForUserIdentity(enterprise);
    EXPECT_FALSE(perUser->existsUserBaseDirectory());
    for (const std::filesystem::path& created : {perUser->userBaseDirectory(), perUser->transientDirectory(),
                                                 perUser->stagingDirectory(), perUser->libraryDirectory()}) {
        EXPECT_TRUE(created.native().starts_with(home.native() + "/")) << created;
        struct stat st = statOf(created);
        EXPECT_EQ(st.st_uid, 502u) << created;
        EXPECT_EQ(st.st_mode & 07777, 0755u) << created;
    }
    EXPECT_TRUE(perUser->existsUserBaseDirectory());
    perUser->systemContainerBackupDirectory();
    perUser->systemGroupContainerBackupDirectory();
    perUser->oldLoggingPath();
    EXPECT_FALSE(std::filesystem::exists(home / "Library/Backup"));
    EXPECT_FALSE(std::filesystem::exists(home / "Library/Logs"));
    EXPECT_EQ(*global->containerDirectoryURLForUserIdentity(enterprise, 7, false), home / "Containers/Shared/AppGroup");

    // A per-user configuration has no global classes; equal identities share one.
    auto mobileConfiguration = global->getPerUserConfigurationForUserIdentity(mobile);
    for (STWContainerClass c : {0ull, 1ull, 12ull, 14ull})
        EXPECT_FALSE(mobileConfiguration->containerDirectoryURLForContentClass(c, false)) << c;
    auto unspecific = STWUserIdentity::initWithUID(501, 501, mobile->homeDirectoryURL(), std::nullopt,
                                                   STWPersonaTypeUnspecific, 501);
    EXPECT_EQ(global->getPerUserConfigurationForUserIdentity(unspecific), mobileConfiguration);
}

TEST_F(STWLayoutTest, OwnersOfGlobalClassesComeFromTheConfiguration) {
    root->writeSettings({{"InstallationUID", STWValue(77)}, {"SystemContainerUID", STWValue(78)}});
    EXPECT_EQ(mobile->posixUIDForContainerClass(3), 77u);
    EXPECT_EQ(mobile->posixGIDForContainerClass(13), 78u);
    EXPECT_EQ(mobile->posixUIDForContainerClass(7), 501u);
    EXPECT_EQ(statOf(*global->containerDirectoryURLForUserIdentity(mobile, 3, false)).st_gid, 77u);
    EXPECT_EQ(statOf(global->transientBundleDirectory()).st_uid, 77u);
    EXPECT_EQ(statOf(*global->containerDirectoryURLForUserIdentity(mobile, 12, true)).st_uid, 78u);

    // Back to the defaults: bundles go back to 33; owner 0 leaves ownership alone.
    root->writeSettings({});
    EXPECT_EQ(statOf(*global->containerDirectoryURLForUserIdentity(mobile, 3, false)).st_uid, 33u);
    EXPECT_EQ(statOf(*global->containerDirectoryURLForUserIdentity(mobile, 12, true)).st_uid, 78u);
    EXPECT_EQ(statOf(*global->containerDirectoryURLForUserIdentity(mobile, 13, true)).st_uid, 0u);
}

} // namespace

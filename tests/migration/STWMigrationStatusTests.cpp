#include "Daemon/Migration/STWMigrationStatus.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWFileIO.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <fstream>
#include <sys/stat.h>

namespace fs = std::filesystem;

namespace {

// A directory of its own in the test root for one store file and its marker files.
fs::path storeDirectory(const char* name) {
    fs::path directory = STWTestRoot::shared().path() / "stores" / name;
    fs::create_directories(directory);
    return directory;
}

void setBuild(const char* build) {
    std::ofstream(STWTestRoot::shared().path() / "etc/os-release") << "BUILD_ID=" << build << "\nRELEASE_TYPE=Internal\n";
    STWTestRoot::shared().writeSettings({});
}

} // namespace

// The marker files of an older daemon end up as one status file with their four types, and
// are gone; two store objects over that file that record at once both stay recorded.
TEST(STWMigrationStatus, MarkerFilesFoldIntoOneStatusFileThatEveryStoreObjectShares) {
    fs::path directory = storeDirectory("fold");
    const char* markers[] = {"stw_bundle_migration_complete.plist", "stw_acl2_migration_complete.plist",
                             "stw_group_id_migration_complete.plist", "stw_code_signing_migration_complete.plist"};
    for (const char* marker : markers)
        ASSERT_TRUE(STW_writeToURL({{"STWMigrationVersionNumber", STWValue(marker)}}, directory / marker,
                                   STWWriteAtomic, nullptr));
    fs::path file = directory / STWMigrationStatus::systemFileName;
    STWMigrationStatus first(file, true);
    for (const char* marker : markers)
        EXPECT_FALSE(fs::exists(directory / marker)) << marker;
    auto stored = STWMigrationStatus::readMigrationInfo(file);
    ASSERT_TRUE(stored);
    EXPECT_EQ(stored->size(), 4u);
    const STWValue::Dictionary* acl = STWDictionaryDictionary(*stored, STWMigrationType::acl);
    ASSERT_TRUE(acl);
    EXPECT_EQ(*STWDictionaryString(*acl, "STWMigrationVersionNumber"), "stw_acl2_migration_complete.plist");

    STWMigrationStatus second(file, true);
    first.setMigrationCompleteForType("FirstMigration");
    second.setMigrationCompleteForType("SecondMigration");
    STWMigrationStatus third(file, true);
    for (const char* type : {STWMigrationType::bundle, STWMigrationType::codeSigning, "FirstMigration",
                             "SecondMigration"})
        EXPECT_TRUE(third.hasMigrationOccurredForType(type)) << type;
}

// No recorded build is an upgrade; the recorded build is not; another one is again.
TEST(STWMigrationStatus, TheRecordedBuildTellsAnUpgrade) {
    fs::path file = storeDirectory("build") / STWMigrationStatus::systemFileName;
    setBuild("10A1");
    EXPECT_TRUE(STWMigrationStatus(file, true).isBuildUpgrade());
    STWMigrationStatus(file, true).writeCurrentBuildInfoToDisk();
    EXPECT_FALSE(STWMigrationStatus(file, true).isBuildUpgrade());
    setBuild("10A2");
    EXPECT_TRUE(STWMigrationStatus(file, true).isBuildUpgrade());
}

// A status file that cannot be read, also one gone bad after it was read, is kept as it is:
// nothing counts as recorded, and recording writes nothing over it.
TEST(STWMigrationStatus, ACorruptStatusFileIsNeverOverwritten) {
    fs::path file = storeDirectory("corrupt") / STWMigrationStatus::systemFileName;
    STWMigrationStatus earlier(file, true);
    std::ofstream(file) << "bplist00 broken";
    STWMigrationStatus status(file, true);
    EXPECT_FALSE(status.migrationInfo());
    EXPECT_FALSE(status.hasMigrationOccurredForType(STWMigrationType::acl));
    for (STWMigrationStatus* store : {&status, &earlier}) {
        store->setMigrationCompleteForType(STWMigrationType::acl);
        store->writeCurrentBuildInfoToDisk();
    }
    std::string contents;
    ASSERT_EQ(STWReadFileContents(file, &contents), 0);
    EXPECT_EQ(contents, "bplist00 broken");
}

// The user's store lies in a directory its apps own: a FIFO in place of the file is not
// waited for, and a link in place of a directory is not followed, for reading or writing.
TEST(STWMigrationStatus, AStoreAnAppTamperedWithIsNeitherWaitedForNorFollowed) {
    fs::path home = storeDirectory("home");
    fs::create_directories(home / "Library/Stowly");
    fs::path fifo = home / "Library/Stowly" / STWMigrationStatus::userFileName;
    ASSERT_EQ(mkfifo(fifo.c_str(), 0666), 0);
    STWMigrationStatus planted(fifo, false, home);
    EXPECT_FALSE(planted.migrationInfo());
    planted.setMigrationCompleteForType(STWMigrationType::subdirectory);
    EXPECT_TRUE(fs::is_fifo(fifo));

    fs::path elsewhere = storeDirectory("elsewhere");
    fs::create_directories(home / "Other");
    fs::create_directory_symlink(elsewhere, home / "Other/Stowly");
    STWMigrationStatus linked(home / "Other/Stowly" / STWMigrationStatus::userFileName, false, home);
    linked.setMigrationCompleteForType(STWMigrationType::subdirectory);
    EXPECT_FALSE(fs::exists(elsewhere / STWMigrationStatus::userFileName));
}

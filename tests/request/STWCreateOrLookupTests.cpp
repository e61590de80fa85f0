#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "Daemon/Request/STWClientConnection.h"
#include "Daemon/STWLocks.h"
#include "platform/STWCrashPoint.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <csignal>
#include <fstream>
#include <future>
#include <stdexcept>
#include <sys/resource.h>

namespace {

std::vector<std::filesystem::path> visibleEntries(const std::filesystem::path& directory) {
    std::vector<std::filesystem::path> found;
    std::error_code ec;
    for (std::filesystem::directory_iterator it(directory, ec), end; !ec && it != end; it.increment(ec))
        if (it->path().filename().native()[0] != '.')
            found.push_back(it->path());
    return found;
}

void drainDeathRow() {
    std::promise<uint64_t> done;
    STWClientConnection::deleteContainersOnDeathRowWithCompletion([&](uint64_t code) { done.set_value(code); });
    EXPECT_EQ(done.get_future().get(), STWErrorSuccess);
}

} // namespace

// A container whose metadata cannot be written never shows up: not in its class
// directory, not in staging, and death row is emptied of it.
TEST(STWCreateOrLookup, FailedMetadataWriteLeavesNothingBehind) {
    STWTestRoot::shared();
    STWClientConnection connection;
    auto user = STWUserIdentityCache::defaultUserIdentity();
    auto good = STWContainerIdentity::containerIdentityWithUserIdentity(user, "com.example.good", 2, nullptr);
    uint64_t error = STWErrorSuccess;
    auto existing = connection.createOrLookupContainerWithContainerIdentity(good, true, false, true, &error);
    ASSERT_NE(existing, nullptr) << error;
    EXPECT_FALSE(existing->existed());
    std::filesystem::path classDirectory = existing->url().parent_path();
    auto staging = STWGlobalConfiguration::sharedInstance()->stagingDirectoryURLForUserIdentity(user, 2);

    // No regular file may grow past 0 bytes: directories still appear, the metadata file
    // cannot be written.
    signal(SIGXFSZ, SIG_IGN);
    rlimit original{};
    getrlimit(RLIMIT_FSIZE, &original);
    rlimit none{0, original.rlim_max};
    ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &none), 0);
    auto doomed = STWContainerIdentity::containerIdentityWithUserIdentity(user, "com.example.doomed", 2, nullptr);
    error = STWErrorSuccess;
    auto result = connection.createOrLookupContainerWithContainerIdentity(doomed, true, false, true, &error);
    setrlimit(RLIMIT_FSIZE, &original);

    EXPECT_EQ(result, nullptr);
    EXPECT_EQ(error, STWErrorWriteFileFailed);
    drainDeathRow();
    EXPECT_EQ(visibleEntries(classDirectory), std::vector<std::filesystem::path>{existing->url()});
    EXPECT_TRUE(visibleEntries(staging).empty());
    EXPECT_TRUE(visibleEntries(STWGlobalConfiguration::sharedInstance()->deathrowDirectory()).empty());

    // The same identity can be created once the disk takes writes again.
    error = STWErrorSuccess;
    EXPECT_NE(connection.createOrLookupContainerWithContainerIdentity(doomed, true, false, true, &error), nullptr);
}

TEST(STWCreateOrLookup, DeathRowPassesToleratePlainFilesAndMissingItems) {
    STWTestRoot::shared();
    STWClientConnection connection;
    auto deathRow = STWGlobalConfiguration::sharedInstance()->deathrowDirectory();
    auto scratch = STWTestRoot::shared().path() / "scratch";
    std::filesystem::create_directories(scratch / "a/b");
    std::ofstream(scratch / "a/b/file") << "x";
    STWErrorRef error;
    EXPECT_TRUE(connection._moveItemAtURLToDeathRow(scratch, true, false, &error));
    EXPECT_FALSE(std::filesystem::exists(scratch));
    // Moving what is not there succeeds and starts nothing.
    EXPECT_TRUE(connection._moveItemAtURLToDeathRow(scratch, true, false, &error));
    drainDeathRow();
    EXPECT_TRUE(visibleEntries(deathRow).empty());
}

// An exception in the middle of a create (here thrown at a crash point) is code 40 and
// leaves no lock held: the next create of the same identity goes through.
TEST(STWCreateOrLookup, AnExceptionInsideALockedCreateReleasesTheLock) {
    STWTestRoot::shared();
    STWClientConnection connection;
    auto user = STWUserIdentityCache::defaultUserIdentity();
    auto identity = STWContainerIdentity::containerIdentityWithUserIdentity(user, "com.example.thrown", 2, nullptr);
    STWCrashPoint::setHandlerForTesting([](std::string_view name) {
        if (name == STWCrashPoint::createAfterStaging)
            throw std::runtime_error("the disk went away");
    });
    uint64_t error = STWErrorSuccess;
    auto thrown = connection.createOrLookupContainerWithContainerIdentity(identity, true, false, true, &error);
    STWCrashPoint::setHandlerForTesting(nullptr);
    EXPECT_EQ(thrown, nullptr);
    EXPECT_EQ(error, STWErrorException);
    STWLocksSnapshot locks = STWLocksCurrentState();
    EXPECT_EQ(locks.allReaderWriterState, 0u);
    EXPECT_EQ(locks.identifierWriterCount + locks.identifierReaderCount, 0u);
    error = STWErrorSuccess;
    auto created = connection.createOrLookupContainerWithContainerIdentity(identity, true, false, true, &error);
    ASSERT_NE(created, nullptr) << error;
    EXPECT_FALSE(created->existed());
}

// A deletion pass may remove a move's fresh "temp." directory before the item is renamed
// into it: the move still moves its item (here the pass strikes at exactly that moment).
TEST(STWCreateOrLookup, AMoveToDeathRowOutlivesAPassThatTookItsDirectory) {
    STWTestRoot::shared();
    STWClientConnection connection;
    auto deathRow = STWGlobalConfiguration::sharedInstance()->deathrowDirectory();
    std::filesystem::path item = STWTestRoot::shared().path() / "raced";
    std::filesystem::create_directories(item);
    bool struck = false;
    STWCrashPoint::setHandlerForTesting([&](std::string_view name) {
        if (name == STWCrashPoint::deathRowAfterTemporaryDirectory && !std::exchange(struck, true))
            for (const auto& entry : visibleEntries(deathRow))
                std::filesystem::remove(entry);
    });
    STWErrorRef error;
    bool moved = connection._moveItemAtURLToDeathRow(item, true, false, &error);
    STWCrashPoint::setHandlerForTesting(nullptr);
    EXPECT_TRUE(moved);
    EXPECT_TRUE(struck);
    EXPECT_FALSE(std::filesystem::exists(item));
    drainDeathRow();
}

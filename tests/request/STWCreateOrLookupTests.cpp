#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "Daemon/Request/STWClientConnection.h"
#include "Daemon/STWLocks.h"
#include "platform/STWCrashPoint.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <fstream>
#include <future>
#include <stdexcept>

namespace fs = std::filesystem;

namespace {

std::vector<fs::path> visibleEntries(const fs::path& directory) {
    std::vector<fs::path> found;
    std::error_code ec;
    for (fs::directory_iterator it(directory, ec), end; !ec && it != end; it.increment(ec))
        if (it->path().filename().native()[0] != '.')
            found.push_back(it->path());
    return found;
}

class STWCreateOrLookup : public ::testing::Test {
protected:
    std::shared_ptr<STWMetadata> create(const std::string& identifier, uint64_t* error) {
        *error = STWErrorSuccess;
        auto identity = STWContainerIdentity::containerIdentityWithUserIdentity(user, identifier, 2, nullptr);
        return connection.createOrLookupContainerWithContainerIdentity(identity, true, false, true, error);
    }
    void drainDeathRow() {
        std::promise<uint64_t> done;
        STWClientConnection::deleteContainersOnDeathRowWithCompletion(
            [&](uint64_t code) { done.set_value(code); });
        EXPECT_EQ(done.get_future().get(), STWErrorSuccess);
        EXPECT_TRUE(visibleEntries(deathRow).empty());
    }

    STWTestRoot& root = STWTestRoot::shared(); // first: the members below read its configuration
    STWClientConnection connection;
    STWUserIdentityRef user = STWUserIdentityCache::defaultUserIdentity();
    fs::path deathRow = STWGlobalConfiguration::sharedInstance()->deathrowDirectory();
};

} // namespace

// An exception in the middle of a create (here thrown at a crash point) is code 40 and
// leaves no lock held: the next create of the same identity goes through.
TEST_F(STWCreateOrLookup, AnExceptionInsideALockedCreateReleasesTheLock) {
    STWCrashPoint::setHandlerForTesting([](std::string_view name) {
        if (name == STWCrashPoint::createAfterStaging)
            throw std::runtime_error("the disk went away");
    });
    uint64_t error;
    auto thrown = create("com.example.thrown", &error);
    STWCrashPoint::setHandlerForTesting(nullptr);
    EXPECT_EQ(thrown, nullptr);
    EXPECT_EQ(error, STWErrorException);
    STWLocksSnapshot locks = STWLocksCurrentState();
    EXPECT_EQ(locks.allReaderWriterState, 0u);
    EXPECT_EQ(locks.identifierWriterCount + locks.identifierReaderCount, 0u);
    auto created = create("com.example.thrown", &error);
    ASSERT_NE(created, nullptr) << error;
    EXPECT_FALSE(created->existed());
}

// A tree goes, a missing item is no failure, and a move whose fresh "temp." directory a
// deletion pass removed before the rename still moves its item.
TEST_F(STWCreateOrLookup, MovesToDeathRowTolerateMissingItemsAndARacingPass) {
    fs::path tree = root.path() / "scratch", raced = root.path() / "raced";
    fs::create_directories(tree / "a/b");
    std::ofstream(tree / "a/b/file") << "x";
    STWErrorRef error;
    EXPECT_TRUE(connection._moveItemAtURLToDeathRow(tree, true, false, &error));
    EXPECT_FALSE(fs::exists(tree));
    EXPECT_TRUE(connection._moveItemAtURLToDeathRow(tree, true, false, &error));
    drainDeathRow();

    fs::create_directories(raced);
    bool struck = false;
    STWCrashPoint::setHandlerForTesting([&](std::string_view name) {
        if (name == STWCrashPoint::deathRowAfterTemporaryDirectory && !std::exchange(struck, true))
            for (const auto& entry : visibleEntries(deathRow))
                fs::remove(entry);
    });
    bool moved = connection._moveItemAtURLToDeathRow(raced, true, false, &error);
    STWCrashPoint::setHandlerForTesting(nullptr);
    EXPECT_TRUE(moved);
    EXPECT_TRUE(struck);
    EXPECT_FALSE(fs::exists(raced));
    drainDeathRow();
}

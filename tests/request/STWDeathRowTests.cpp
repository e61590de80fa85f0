#include "Daemon/FileSystem/STWFaultInjection.h"
#include "Daemon/Lifecycle/STWCommandStageForDelete.h"
#include "Daemon/Lifecycle/STWDaemonQueues.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "Daemon/Request/STWClientConnection.h"
#include "platform/STWPlatformConfiguration.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <fcntl.h>
#include <fstream>
#include <future>
#include <map>

namespace fs = std::filesystem;

namespace {

class STWDeathRow : public ::testing::Test {
protected:
    uint64_t pass() {
        std::promise<uint64_t> done;
        STWClientConnection::deleteContainersOnDeathRowWithCompletion([&](uint64_t code) { done.set_value(code); });
        return done.get_future().get();
    }
    STWContainerIdentityRef identity(const std::string& identifier) {
        return STWContainerIdentity::containerIdentityWithUserIdentity(user, identifier, 2, nullptr);
    }

    STWTestRoot& root = STWTestRoot::shared();
    STWClientConnection connection;
    STWUserIdentityRef user = STWUserIdentityCache::defaultUserIdentity();
    fs::path deathRow = STWGlobalConfiguration::sharedInstance()->deathrowDirectory();
};

} // namespace

// A stage-for-delete that cannot find its first container still stages the second, tells
// onError the look-up's code and answers success, so the queue goes on.
TEST_F(STWDeathRow, StagingGoesOnPastAContainerItCannotFind) {
    uint64_t code = STWErrorSuccess;
    auto made = connection.createOrLookupContainerWithContainerIdentity(identity("com.example.staged"), true, false,
                                                                        true, &code);
    ASSERT_TRUE(made);
    std::vector<uint64_t> reported;
    auto queue = STWCommandQueue::init();
    queue->insertCommand(STWCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
        {identity("com.example.unknown"), identity("com.example.staged")}, true,
        [&](uint64_t error) { reported.push_back(error); }));
    EXPECT_TRUE(queue->executeAllUntilExhaustedOrError(&code));
    EXPECT_EQ(reported, std::vector<uint64_t>{STWErrorNotFound});
    EXPECT_FALSE(fs::exists(made->url()));
    EXPECT_TRUE(fs::is_directory(deathRow / made->url().filename()));
    EXPECT_EQ(pass(), STWErrorSuccess);
}

// Nothing to move is moved (and starts no pass); what a pass cannot remove is moved aside
// to the temporary directory, and the pass still completes.
TEST_F(STWDeathRow, WhatIsNotThereOrWillNotGoDoesNotStopDeathRow) {
    fs::create_directories(deathRow / "kept");
    STWErrorRef error;
    EXPECT_TRUE(connection._moveItemAtURLToDeathRow(root.resolve("/private/var/missing"), true, true, &error));
    STWDaemonQueues::deathRow()->sync([] {});
    EXPECT_TRUE(fs::exists(deathRow / "kept")) << "no pass was started";
    EXPECT_EQ(pass(), STWErrorSuccess);

    fs::create_directories(deathRow / "kept");
    std::ofstream(deathRow / "kept/file") << "x";
    ASSERT_TRUE(STWFaultInjection::arm("unlinkat", 1, EIO));
    EXPECT_EQ(pass(), STWErrorSuccess);
    STWFaultInjection::disarm();
    fs::path aside = STWPlatformConfiguration::sharedInstance()->resolve("/tmp") / "kept";
    EXPECT_TRUE(fs::exists(aside / "file"));
    EXPECT_FALSE(fs::exists(deathRow / "kept"));
    fs::remove_all(aside);
}

// A batch's items share one fresh directory in death row, and a name that one holds
// already starts another; no pass takes the directory a batch is filling, so nothing
// arrives in one being removed. The pass after the batch takes everything.
TEST_F(STWDeathRow, ABatchSharesOneDirectoryThatPassesLeaveWhileItFills) {
    fs::path first = root.resolve("/private/var/batch1"), second = root.resolve("/private/var/batch2");
    std::vector<fs::path> items{first / "a", first / "b", second / "a"};
    for (const fs::path& item : items)
        fs::create_directories(item / "Documents");
    auto batch = std::make_unique<STWClientConnection::DeathRowBatch>();
    for (const fs::path& item : items) {
        STWFileDescriptor parent(open(item.parent_path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        STWFileDescriptor fd(open(item.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
        STWErrorRef error;
        EXPECT_TRUE(connection._moveItemAtToDeathRow(parent.get(), item.filename(), fd.get(), item, &error,
                                                     STWFileManagerMoveDefault, batch.get()))
            << item;
    }
    auto held = [&] { // each directory of death row: how many items it holds
        std::map<std::string, size_t> counts;
        for (const auto& entry : fs::directory_iterator(deathRow))
            counts[entry.path().filename()] = std::distance(fs::directory_iterator(entry), fs::directory_iterator());
        return counts;
    };
    auto before = held();
    ASSERT_EQ(before.size(), 2u);
    auto filling = std::find_if(before.begin(), before.end(), [](const auto& d) { return d.second == 1; });
    ASSERT_NE(filling, before.end());

    EXPECT_EQ(pass(), STWErrorSuccess);
    EXPECT_EQ(held(), (std::map<std::string, size_t>{*filling})) << "the filled one goes, the filling one stays";
    EXPECT_TRUE(fs::is_directory(deathRow / filling->first / "a/Documents"));
    batch.reset();
    EXPECT_EQ(pass(), STWErrorSuccess);
    EXPECT_TRUE(fs::is_empty(deathRow));
    EXPECT_TRUE(fs::is_empty(first) && fs::is_empty(second));
    fs::remove(first);
    fs::remove(second);
}

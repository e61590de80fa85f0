#include "Daemon/FileSystem/STWFaultInjection.h"
#include "Daemon/Lifecycle/STWCommandStageForDelete.h"
#include "Daemon/Lifecycle/STWDaemonQueues.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "Daemon/Request/STWClientConnection.h"
#include "platform/STWPlatformConfiguration.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <fstream>
#include <future>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <unistd.h>

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

// A container that will neither move to death row nor go whole in place (here an
// append-only file in it) keeps its metadata file: it is still a container, found at its
// path, not a stray directory for a later sweep.
TEST_F(STWDeathRow, AContainerThatWillNotGoStaysAContainer) {
    uint64_t code = STWErrorSuccess;
    auto made = connection.createOrLookupContainerWithContainerIdentity(identity("com.example.stuck"), true, false,
                                                                        true, &code);
    ASSERT_TRUE(made);
    fs::path stuck = made->url() / "Library/stuck";
    std::ofstream(stuck) << "x";
    auto setFlags = [&](int flags) {
        int fd = open(stuck.c_str(), O_RDONLY | O_CLOEXEC);
        bool set = fd >= 0 && ioctl(fd, FS_IOC_SETFLAGS, &flags) == 0;
        close(fd);
        return set;
    };
    if (!setFlags(FS_APPEND_FL))
        GTEST_SKIP() << "the append-only flag cannot be set here (file system or privileges)";
    auto queue = STWCommandQueue::init();
    queue->insertCommand(STWCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
        {made->containerIdentity()}, true, nullptr));
    bool armed = STWFaultInjection::arm("renameat2", 1, EIO);
    EXPECT_TRUE(queue->executeAllUntilExhaustedOrError(&code));
    STWFaultInjection::disarm();
    EXPECT_TRUE(setFlags(0)) << "the test root could not be removed";
    ASSERT_TRUE(armed);
    EXPECT_TRUE(fs::exists(made->url() / STWMetadata::fileName));
    auto found = connection.createOrLookupContainerWithContainerIdentity(identity("com.example.stuck"), false, false,
                                                                         true, &code);
    ASSERT_TRUE(found);
    EXPECT_EQ(found->url(), made->url());
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

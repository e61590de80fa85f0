// Protection-class changes in process.
#include "Daemon/DataProtection/STWDataProtectionChangeOperation.h"
#include "Daemon/DataProtection/STWDataProtectionManager.h"
#include "Daemon/Lifecycle/STWDaemonQueues.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "Daemon/Request/STWClientConnection.h"
#include "common/STWDictionaryUtilities.h"
#include "platform/STWKeybag.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <fstream>
#include <future>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

namespace fs = std::filesystem;

namespace {

constexpr const char* kAttribute = "trusted.stowly.protection-class";

int32_t classOf(const fs::path& item) {
    uint32_t value = 0;
    ssize_t n = lgetxattr(item.c_str(), kAttribute, &value, sizeof value);
    return n == sizeof value ? static_cast<int32_t>(value) : 0;
}
void setClass(const fs::path& item, int32_t protectionClass) {
    ASSERT_EQ(lsetxattr(item.c_str(), kAttribute, &protectionClass, sizeof protectionClass, 0), 0) << item;
}
void write(const fs::path& file, const std::string& text = "x") { std::ofstream(file) << text; }

class STWDataProtectionChange : public ::testing::Test {
protected:
    void SetUp() override { STWKeybag::setLockStateOverrideForTesting(false); }
    void TearDown() override { STWKeybag::setLockStateOverrideForTesting(std::nullopt); }

    STWContainerIdentityRef identity(const std::string& identifier) {
        return STWContainerIdentity::containerIdentityWithUserIdentity(STWUserIdentityCache::defaultUserIdentity(),
                                                                      identifier, 2, nullptr);
    }
    STWMetadataRef container(const std::string& identifier) {
        uint64_t code = STWErrorSuccess;
        auto made = connection.createOrLookupContainerWithContainerIdentity(identity(identifier), true, false, true,
                                                                            &code);
        EXPECT_TRUE(made) << code;
        for (const char* name : {"Documents", "Library", "tmp"})
            fs::create_directories(made->url() / name);
        return made;
    }
    uint64_t change(const std::string& identifier, int32_t protectionClass, bool thirdParty = false) {
        std::promise<uint64_t> done;
        manager->setDataProtectionOnDataContainerForContainerIdentity(identity(identifier), protectionClass, thirdParty,
                                                                      false, [&](uint64_t c) { done.set_value(c); });
        return done.get_future().get();
    }
    std::optional<int64_t> recordedClass(const std::string& identifier) {
        auto metadata = connection.createOrLookupContainerWithContainerIdentity(identity(identifier), false, false,
                                                                                true, nullptr);
        const STWValue* value = metadata && metadata->info()
                                    ? STWDictionaryFind(*metadata->info(), STWMetadata::contentProtectionClassInfoKey)
                                    : nullptr;
        return value ? value->int64Value() : std::nullopt;
    }
    fs::path updateFile(const STWMetadataRef& metadata) {
        return STWDataProtectionChangeOperation::urlForProtectionOperationWithContainerIdentity(
            *metadata->containerIdentity());
    }

    // First: the daemon's objects keep the root they first see.
    STWTestRoot& root = STWTestRoot::shared();
    STWClientConnection connection;
    std::shared_ptr<STWDataProtectionManager> manager = STWDataProtectionManager::defaultManager();
};

} // namespace

// Stronger classes reach files (never one at class 2, never a weaker one); weaker classes
// only directories; asking for the current class walks nothing and drops a pending change.
TEST_F(STWDataProtectionChange, TheChangeTypeDecidesWhatIsReprotected) {
    auto made = container("com.example.classes");
    fs::path docs = made->url() / "Documents", nested = made->url() / "Library/Caches";
    fs::create_directories(nested);
    write(docs / "a"), write(docs / "b"), write(nested / "c"), write(nested / "d");

    EXPECT_EQ(change("com.example.classes", 3), STWErrorSuccess); // from none: directories only
    EXPECT_EQ(classOf(docs), 3);
    EXPECT_EQ(classOf(nested), 3);
    EXPECT_EQ(classOf(docs / "a"), 0);
    EXPECT_EQ(recordedClass("com.example.classes"), 3);

    setClass(docs / "b", 2), setClass(nested / "c", 4), setClass(nested / "d", 1);
    EXPECT_EQ(change("com.example.classes", 1), STWErrorSuccess); // 3 to 1: directories and files
    EXPECT_EQ(classOf(docs), 1);
    EXPECT_EQ(classOf(docs / "a"), 1); // it had none
    EXPECT_EQ(classOf(docs / "b"), 2);
    EXPECT_EQ(classOf(nested / "c"), 1);

    EXPECT_EQ(change("com.example.classes", 4), STWErrorSuccess); // 1 to 4: directories only
    EXPECT_EQ(classOf(docs), 4);
    EXPECT_EQ(classOf(docs / "a"), 1);

    setClass(nested / "c", 4);
    EXPECT_EQ(change("com.example.classes", 3), STWErrorSuccess); // 4 to 3: files only get stronger
    EXPECT_EQ(classOf(nested / "c"), 3);
    EXPECT_EQ(classOf(docs / "a"), 1);
    EXPECT_EQ(classOf(docs / "b"), 2);
    EXPECT_EQ(recordedClass("com.example.classes"), 3);

    write(updateFile(made), "stale");
    setClass(docs, 4);
    EXPECT_EQ(change("com.example.classes", 3), STWErrorSuccess);
    EXPECT_EQ(classOf(docs), 4);
    EXPECT_FALSE(fs::exists(updateFile(made)));

    EXPECT_EQ(change("com.example.classes", 2), STWErrorInvalidArgument);
    EXPECT_EQ(change("com.example.classes", 4, true), STWErrorInvalidArgument);
    EXPECT_EQ(change("com.example.absent", 1), STWErrorNotFound);
    EXPECT_EQ(recordedClass("com.example.classes"), 3);
}

// Whatever the app planted, the walk stays in its container, does not wait on a FIFO, and
// sets no class on a file that is only linked into the container.
TEST_F(STWDataProtectionChange, PlantedLinksAndFIFOsAreNeverFollowedOrOpened) {
    auto made = container("com.example.hostile");
    fs::path outside = root.path() / "outside-dp";
    fs::create_directories(outside / "dir");
    write(outside / "secret"), write(outside / "dir/inner"), write(outside / "linked");
    ASSERT_EQ(chown(outside.c_str(), 0, 0), 0);
    fs::path docs = made->url() / "Documents";
    fs::create_symlink(outside / "secret", docs / "file-link");
    fs::create_directory_symlink(outside / "dir", docs / "dir-link");
    fs::create_symlink("loop", docs / "loop");
    ASSERT_EQ(mkfifo((docs / "pipe").c_str(), 0644), 0);
    ASSERT_EQ(link((outside / "linked").c_str(), (docs / "hard").c_str()), 0);
    fs::remove_all(made->url() / "Library");
    fs::create_directory_symlink(outside / "dir", made->url() / "Library");
    write(docs / "mine");
    ASSERT_EQ(chown((docs / "mine").c_str(), 501, 501), 0);
    for (const char* item : {"secret", "dir/inner", "linked"})
        setClass(outside / item, 3);

    EXPECT_EQ(change("com.example.hostile", 1), STWErrorSuccess);
    EXPECT_EQ(classOf(docs / "mine"), 1);
    EXPECT_EQ(classOf(docs), 1);
    EXPECT_EQ(classOf(outside / "dir"), 0);
    for (const char* item : {"secret", "dir/inner", "linked"})
        EXPECT_EQ(classOf(outside / item), 3) << item;
    fs::remove_all(outside);
}

// Locked with retrying allowed, nothing completes until the unlock; then the application is
// stopped once and the change finishes. (The answer after the unlock and 61 without
// retrying are checked over the socket.)
TEST_F(STWDataProtectionChange, ALockedChangeWaitsForTheUnlock) {
    auto made = container("com.example.locked");
    fs::path file = made->url() / "Documents/f";
    write(file);
    setClass(file, 1);
    auto queue = STWDaemonQueues::lockState();
    queue->suspend(); // as the lock-state watch does while the device is locked
    STWKeybag::setLockStateOverrideForTesting(true);

    auto operation = STWDataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
        made, 3, true, STWDataProtectionChangeDirectories | STWDataProtectionChangeFiles,
        manager->protectionOperationFileQueue());
    int starts = 0;
    std::promise<STWErrorRef> done;
    operation->setRetryStartBlock([&] { ++starts; });
    operation->setCompletionBlock([&](bool wasLocked, const STWErrorRef& error) {
        EXPECT_FALSE(wasLocked);
        done.set_value(error);
    });
    ASSERT_TRUE(operation->writeToDiskWithError(nullptr));
    operation->performChangeOperation();
    auto result = done.get_future();
    EXPECT_EQ(result.wait_for(std::chrono::milliseconds(200)), std::future_status::timeout);

    STWKeybag::setLockStateOverrideForTesting(false);
    queue->resume();
    EXPECT_EQ(result.get(), nullptr);
    EXPECT_EQ(starts, 1);
    EXPECT_TRUE(operation->retried());
    EXPECT_EQ(classOf(file), 3);
    EXPECT_FALSE(fs::exists(updateFile(made)));
}

// Two changes of one container: the older finds the newer's file and stops with 69,
// leaving it; the newer then runs and removes it.
TEST_F(STWDataProtectionChange, ANewerChangeSupersedesAnOlderOne) {
    auto made = container("com.example.twice");
    auto fileQueue = manager->protectionOperationFileQueue();
    auto older = STWDataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
        made, 1, false, STWDataProtectionChangeDirectories, fileQueue);
    auto newer = STWDataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
        made, 3, false, STWDataProtectionChangeDirectories, fileQueue);
    ASSERT_TRUE(older->writeToDiskWithError(nullptr));
    ASSERT_TRUE(newer->writeToDiskWithError(nullptr));
    STWErrorRef olderError = nullptr, newerError = STW_ERROR_NOLOG(1, nullptr, "not run");
    older->setCompletionBlock([&](bool, const STWErrorRef& e) { olderError = e; });
    newer->setCompletionBlock([&](bool, const STWErrorRef& e) { newerError = e; });
    older->performChangeOperation();
    ASSERT_TRUE(olderError);
    EXPECT_EQ(olderError->code(), STWErrorSuperseded);
    EXPECT_EQ(classOf(made->url() / "Documents"), 0);
    EXPECT_TRUE(fs::exists(updateFile(made)));
    newer->performChangeOperation();
    EXPECT_EQ(newerError, nullptr);
    EXPECT_EQ(classOf(made->url() / "Documents"), 3);
    EXPECT_FALSE(fs::exists(updateFile(made)));
}

// The reader refuses what a damaged file holds, with the code its check names; a good
// file comes back as the same change, and a restart finishes it (and drops the change of a
// container that is gone).
TEST_F(STWDataProtectionChange, UpdateFilesAreCheckedAndRestarted) {
    auto cache = STWUserIdentitySharedCache::sharedInstance();
    fs::path scratch = root.path() / "update.plist";
    auto codeOf = [&](const STWValue::Dictionary& contents) -> int64_t {
        EXPECT_TRUE(STW_writeToURL(contents, scratch, 0, nullptr));
        STWErrorRef error;
        auto info = STWDataProtectionChangeOperation::_readAndValidateDataProtectionUpdateAtURL(scratch, *cache, &error);
        return info ? 1 : error->code();
    };
    STWValue::Dictionary good{{"STWDataOperationIdentifier", STWValue("com.example.restart")},
                              {"STWDataOperationContainerClass", STWValue(uint64_t{12})},
                              {"STWDataOperationProtectionClass", STWValue(int32_t{1})},
                              {"STWDataOperationChangeType", STWValue(uint32_t{7})},
                              {"STWDataOperationRetryIfLocked", STWValue(false)},
                              {"STWDataOperationInternalID", STWValue(STWUUID::random().string())}};
    EXPECT_EQ(codeOf(good), 1);
    const std::pair<const char*, STWValue> damages[] = {
        {"STWDataOperationContainerClass", STWValue(uint64_t{0})},
        {"STWDataOperationContainerClass", STWValue(uint64_t{14})},
        {"STWDataOperationContainerClass", STWValue(uint64_t{2})}, // a per-user class without a user id
        {"STWDataOperationIdentifier", STWValue(STWValue::Array{})},
        {"STWDataOperationProtectionClass", STWValue(STWValue::Array{})},
        {"STWDataOperationRetryIfLocked", STWValue(STWValue::Array{})},
        {"STWDataOperationInternalID", STWValue(STWValue::Array{})}};
    for (const auto& [key, value] : damages) {
        auto damaged = good;
        damaged[key] = value;
        EXPECT_EQ(codeOf(damaged), STWErrorInvalidContent) << key << " " << value.description();
    }
    good["STWDataOperationContainerClass"] = STWValue(uint64_t{2});
    good["STWDataOperationUserId"] = STWValue(uint64_t{501});
    EXPECT_EQ(codeOf(good), 1);
    write(scratch, "not a property list");
    STWErrorRef error;
    EXPECT_FALSE(STWDataProtectionChangeOperation::_readAndValidateDataProtectionUpdateAtURL(scratch, *cache, &error));
    EXPECT_EQ(error->code(), STWErrorReadFileFailed);
    EXPECT_FALSE(STWDataProtectionChangeOperation::_readAndValidateDataProtectionUpdateAtURL({}, *cache, &error));
    EXPECT_EQ(error->code(), STWErrorInvalidArgument);

    auto made = container("com.example.restart");
    auto pending = STWDataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
        made, 1, true, STWDataProtectionChangeDirectories, manager->protectionOperationFileQueue());
    ASSERT_TRUE(pending->writeToDiskWithError(nullptr));
    auto restored = STWDataProtectionChangeOperation::dataProtectionChangeOperationAtURL(
        updateFile(made), manager->protectionOperationFileQueue(), nullptr);
    ASSERT_TRUE(restored);
    EXPECT_EQ(restored->internalChangeID(), pending->internalChangeID());
    EXPECT_EQ(restored->dataContainerMetadata()->url(), made->url());
    EXPECT_TRUE(restored->retryIfLocked());

    // Beside it: the file of a change whose container has been deleted since, which the
    // restart removes, and one it cannot read, which it leaves.
    fs::path pendingUpdates = updateFile(made).parent_path();
    good["STWDataOperationIdentifier"] = STWValue("com.example.deleted");
    ASSERT_TRUE(STW_writeToURL(good, pendingUpdates / "deleted.plist", 0, nullptr));
    write(pendingUpdates / "unreadable.plist", "not a property list");

    EXPECT_TRUE(manager->restartPendingDataProtectionOperationsWithError(nullptr));
    EXPECT_EQ(classOf(made->url() / "Documents"), 1);
    EXPECT_EQ(recordedClass("com.example.restart"), 1);
    EXPECT_FALSE(fs::exists(updateFile(made)));
    EXPECT_FALSE(fs::exists(pendingUpdates / "deleted.plist"));
    EXPECT_TRUE(fs::remove(pendingUpdates / "unreadable.plist"));
}

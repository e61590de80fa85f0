#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Lifecycle/STWContainerCache.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "tests/lifecycle/STWLifecycleTestSupport.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <fstream>
#include <set>
#include <thread>

namespace fs = std::filesystem;

namespace {

class STWContainerCacheTest : public ::testing::Test {
protected:
    void SetUp() override {
        STWLifecycleTestSetUpRoot();
        store = std::make_shared<STWRecordingSandboxMappingStore>();
        STWSandboxMappingStore::setSharedInstance(store);
        cache = std::make_shared<STWContainerCache>(STWUserIdentitySharedCache::sharedInstance());
        mobile = STWTestPersonalIdentity();
    }

    STWContainerIdentityRef identity(const std::string& identifier, STWContainerClass c = 2,
                                     const STWUserIdentityRef& user = nullptr) {
        return STWContainerIdentity::containerIdentityWithUserIdentity(user ? user : mobile, identifier, c, nullptr);
    }
    STWMetadataRef lookup(const std::string& identifier, STWErrorRef* error, bool transient = false,
                          STWContainerClass c = 2) {
        return cache->containerForContainerIdentity(identity(identifier, c), transient, true, error);
    }
    fs::path classDirectory(STWContainerClass c = 2) {
        return *STWGlobalConfiguration::sharedInstance()->containerDirectoryURLForUserIdentity(mobile, c, false);
    }

    std::shared_ptr<STWRecordingSandboxMappingStore> store;
    std::shared_ptr<STWContainerCache> cache;
    STWUserIdentityRef mobile;
};

TEST_F(STWContainerCacheTest, RebuildTakesValidContainersAndSkipsEverythingElse) {
    auto good = STWMakeTestContainer(mobile, "com.example.good", 2);
    // A valid metadata file in a directory that is not named by a UUID.
    STWMakeTestContainer(mobile, "com.example.badname", 2, false, std::string("not-a-uuid"));
    // No metadata; garbage metadata; a plug-in's container moved into the application class.
    fs::create_directories(classDirectory() / STWUUID::random().string());
    fs::path garbage = classDirectory() / STWUUID::random().string();
    fs::create_directories(garbage);
    std::ofstream(garbage / STWMetadata::fileName) << "this is not a property list";
    auto plugin = STWMakeTestContainer(mobile, "com.example.plugin", 4);
    fs::rename(plugin.url, classDirectory() / plugin.url.filename());
    // A link named by a UUID to a valid container outside the class directory.
    auto elsewhere = STWMakeTestContainer(mobile, "com.example.linked", 2);
    fs::path outside = STWTestRoot::shared().resolve("/private/var/outside");
    fs::create_directories(outside.parent_path());
    fs::rename(elsewhere.url, outside);
    fs::create_directory_symlink(outside, classDirectory() / STWUUID::random().string());

    STWErrorRef error;
    auto all = cache->allContainersForUserIdentity(mobile, 2, false, &error);
    ASSERT_TRUE(all) << error->description();
    ASSERT_EQ(all->size(), 1u);
    EXPECT_EQ((*all)[0]->url(), good.url);
    EXPECT_EQ((*all)[0]->uuid(), good.metadata->uuid());
    EXPECT_FALSE((*all)[0]->transient());
    EXPECT_EQ(store->mappings().size(), 1u);

    for (const char* skipped : {"com.example.badname", "com.example.plugin", "com.example.linked"}) {
        EXPECT_FALSE(lookup(skipped, &error)) << skipped;
        EXPECT_TRUE(error->is(21)) << error->description();
    }
}

// Changed behind the cache's back: a vanished container loses its record and mapping (its 44
// then 21 is checked over the socket); look-ups check the metadata file beneath the class
// directory the cache opened.
TEST_F(STWContainerCacheTest, ContainersAndClassDirectoriesChangedBehindTheCachesBack) {
    auto doomed = STWMakeTestContainer(mobile, "com.example.doomed", 2);
    STWErrorRef error;
    ASSERT_TRUE(lookup("com.example.doomed", &error));
    ASSERT_EQ(store->mappings().size(), 1u);
    STWFileManager::defaultManager()->removeItemAtURL(doomed.url / STWMetadata::fileName);
    EXPECT_FALSE(lookup("com.example.doomed", &error));
    ASSERT_TRUE(error && error->is(44));
    EXPECT_TRUE(store->mappings().empty());

    // The bulk look-up drops a stale record without failing.
    auto kept = STWMakeTestContainer(mobile, "com.example.kept", 2);
    auto gone = STWMakeTestContainer(mobile, "com.example.gone", 2);
    ASSERT_TRUE(cache->addContainerMetadata(kept.metadata, kept.url, false, true, &error));
    ASSERT_TRUE(cache->addContainerMetadata(gone.metadata, gone.url, false, true, &error));
    STWFileManager::defaultManager()->removeItemAtURL(gone.url);
    auto all = cache->allContainersForUserIdentity(mobile, 2, false, &error);
    ASSERT_TRUE(all);
    ASSERT_EQ(all->size(), 1u);
    EXPECT_EQ((*all)[0]->identifier(), "com.example.kept");
    EXPECT_FALSE(lookup("com.example.gone", &error));
    EXPECT_TRUE(error->is(21));

    // A replaced class directory is opened again, and the old one no longer counts.
    auto moved = STWMakeTestContainer(mobile, "com.example.moved", 2);
    ASSERT_TRUE(cache->addContainerMetadata(moved.metadata, moved.url, false, true, &error));
    ASSERT_TRUE(lookup("com.example.moved", &error));
    fs::path old = classDirectory().native() + ".old";
    fs::rename(classDirectory(), old);
    fs::create_directory(classDirectory());
    fs::rename(old / moved.url.filename(), moved.url);
    auto found = lookup("com.example.moved", &error);
    ASSERT_TRUE(found) << error->description();
    EXPECT_EQ(found->url(), moved.url);
    fs::rename(moved.url, old / moved.url.filename());
    EXPECT_FALSE(lookup("com.example.moved", &error));
    EXPECT_TRUE(error && error->is(44));

    // A class directory that cannot be listed fails with 43 and caches nothing.
    fs::path tolvan = classDirectory(9);
    auto service = STWMakeTestContainer(mobile, "com.example.service", 9);
    fs::rename(tolvan, tolvan.string() + ".aside");
    std::ofstream(tolvan) << "not a directory";
    EXPECT_FALSE(lookup("com.example.service", &error, false, 9));
    ASSERT_TRUE(error->is(43));
    EXPECT_TRUE(error->underlyingError() && error->underlyingError()->isPOSIX(ENOTDIR));
    fs::remove(tolvan);
    fs::rename(tolvan.string() + ".aside", tolvan);
    EXPECT_TRUE(lookup("com.example.service", &error, false, 9));
}

TEST_F(STWContainerCacheTest, DuplicateIdentifiersOnDiskKeepTheLaterEntryInListingOrder) {
    std::set<fs::path> copies;
    for (int i = 0; i < 6; ++i)
        copies.insert(STWMakeTestContainer(mobile, "com.example.twin", 2).url);
    fs::path last;
    auto listing = STWFileManager::defaultManager()->urlsForItemsInDirectoryAtURL(classDirectory());
    ASSERT_TRUE(listing);
    for (const fs::path& entry : *listing)
        if (copies.count(entry))
            last = entry;

    STWErrorRef error;
    auto found = lookup("com.example.twin", &error);
    ASSERT_TRUE(found) << error->description();
    EXPECT_EQ(found->url(), last);
    auto all = cache->allContainersForUserIdentity(mobile, 2, false, &error);
    ASSERT_EQ(all->size(), 1u);
    // The mapping ends up at the container that stays.
    auto mappings = store->mappings();
    ASSERT_EQ(mappings.size(), 1u);
    EXPECT_EQ(mappings.begin()->second, last);
}

TEST_F(STWContainerCacheTest, TransientAndLiveCachesAreSeparateAndConcreteLookupsPickByUUID) {
    auto live = STWMakeTestContainer(mobile, "com.example.app", 2);
    auto transient = STWMakeTestContainer(mobile, "com.example.app", 2, true);
    auto byUUID = [&](const STWMetadataRef& m) {
        return cache->containerForContainerIdentity(
            STWConcreteContainerIdentity::containerIdentityWithUUID(m->uuid(), mobile, "com.example.app", 2, nullptr));
    };
    for (const auto& [container, transientOne] : {std::pair{&transient, true}, std::pair{&live, false}}) {
        auto found = byUUID(container->metadata);
        ASSERT_TRUE(found);
        EXPECT_EQ(found->transient(), transientOne);
        EXPECT_EQ(found->url(), container->url);
    }
    EXPECT_FALSE(byUUID(STWMakeTestContainer(mobile, "com.example.other", 2).metadata));
    // Only the live container is mapped, and removing the transient record leaves it so.
    STWErrorRef error;
    ASSERT_TRUE(cache->removeContainerForUserIdentity(mobile, 2, "com.example.app", true, &error));
    EXPECT_FALSE(lookup("com.example.app", &error, true));
    EXPECT_TRUE(lookup("com.example.app", &error));
    auto mappings = store->mappings();
    ASSERT_EQ(mappings.size(), 1u);
    EXPECT_EQ(mappings.begin()->second, live.url);
}

TEST_F(STWContainerCacheTest, UnspecificIdentitySeesPersonalAndEnterpriseContainers) {
    auto enterprise = STWTestEnterpriseIdentity();
    STWMakeTestContainer(mobile, "com.example.personal", 2);
    STWMakeTestContainer(enterprise, "com.work.mail", 2);
    STWErrorRef error;
    auto unspecific = STWUserIdentitySharedCache::sharedInstance()->unspecificUserIdentity();
    auto all = cache->allContainersForUserIdentity(unspecific, 2, false, &error);
    ASSERT_TRUE(all) << error->description();
    std::set<std::string> identifiers;
    for (const auto& record : *all)
        identifiers.insert(record->identifier());
    EXPECT_EQ(identifiers, (std::set<std::string>{"com.example.personal", "com.work.mail"}));
    // The unspecific identity shares the personal class cache: no second rebuild.
    EXPECT_TRUE(cache->containerForContainerIdentity(identity("com.example.personal", 2, unspecific), false, true, &error));
    EXPECT_EQ(store->pushCount("com.example.personal"), 1);
    // Enterprise containers are not in the personal cache.
    EXPECT_FALSE(lookup("com.work.mail", &error));
}

TEST_F(STWContainerCacheTest, ConcurrentLookupsAndAddsDuringTheFirstRebuild) {
    constexpr int containers = 120;
    std::vector<STWTestContainer> made;
    for (int i = 0; i < containers; ++i)
        made.push_back(STWMakeTestContainer(mobile, STWFormat("com.example.app%d", i), 2));

    std::atomic<bool> go{false};
    std::atomic<int> failures{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 6; ++t) {
        threads.emplace_back([&, t] {
            while (!go)
                std::this_thread::yield();
            for (int i = t; i < containers; i += 6) {
                STWErrorRef error;
                auto record = lookup(STWFormat("com.example.app%d", i), &error);
                if (!record || record->uuid() != made[i].metadata->uuid())
                    failures++;
            }
        });
    }
    // Adds racing the rebuild must survive it. Their directories are kept out of the class
    // directory, so only the add can have put them in the cache.
    std::vector<STWTestContainer> added;
    fs::path staged = STWTestRoot::shared().resolve("/private/var/staged");
    fs::create_directories(staged);
    for (int i = 0; i < 10; ++i) {
        auto container = STWMakeTestContainer(mobile, STWFormat("com.example.new%d", i), 2);
        container.url = staged / container.url.filename();
        fs::rename(container.metadata->url(), container.url);
        added.push_back(container);
    }
    threads.emplace_back([&] {
        while (!go)
            std::this_thread::yield();
        for (const auto& container : added) {
            STWErrorRef error;
            if (!cache->addContainerMetadata(container.metadata, container.url, false, true, &error))
                failures++;
        }
    });
    go = true;
    for (auto& thread : threads)
        thread.join();
    EXPECT_EQ(failures, 0);

    STWErrorRef error;
    auto all = cache->allContainersForUserIdentity(mobile, 2, false, &error);
    ASSERT_TRUE(all);
    EXPECT_EQ(all->size(), static_cast<size_t>(containers + 10));
    // One rebuild: each container found on disk was pushed once.
    for (int i = 0; i < containers; ++i)
        EXPECT_EQ(store->pushCount(STWFormat("com.example.app%d", i)), 1) << i;
}

TEST_F(STWContainerCacheTest, AnExceptionInsideAnOperationBecomesCode40OrStopsAnInternalImage) {
    STWMakeTestContainer(mobile, "com.example.app", 2);
    store->throwOnSet = true;
    STWErrorRef error;
    EXPECT_FALSE(lookup("com.example.app", &error));
    ASSERT_TRUE(error && error->is(40));
    EXPECT_EQ(error->message(), "Got exception: std::runtime_error : sandbox state store went away");
    // Nothing half-built was kept, and the lock is free again.
    store->throwOnSet = false;
    EXPECT_TRUE(lookup("com.example.app", &error));
    EXPECT_EQ(store->pushCount("com.example.app"), 1);

    // On an internal image the same exception stops the daemon with its report instead.
    STWMakeTestContainer(mobile, "com.example.service", 9);
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(
        {
            STWGlobalConfiguration::sharedInstance()->setIsInternalImage(true);
            store->throwOnSet = true;
            lookup("com.example.service", &error, false, 9);
        },
        "INTERNAL ERROR: Uncaught Exception \\*\\*\nException: .*std::runtime_error: sandbox state store went away\nStack:");
}

} // namespace

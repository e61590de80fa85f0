#include "Daemon/Lifecycle/STWContainerCache.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "tests/lifecycle/STWLifecycleTestSupport.h"
#include "common/STWFileDescriptor.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <fcntl.h>
#include <fstream>
#include <set>
#include <sys/stat.h>
#include <thread>
#include <utility>
#include <vector>

namespace fs = std::filesystem;

namespace {

class STWSandboxMappingTest : public ::testing::Test {
protected:
    void SetUp() override {
        STWLifecycleTestSetUpRoot();
        base = STWTestRoot::shared().resolve("/run/stowly/sandbox");
        store = std::make_shared<STWFileSandboxMappingStore>(base);
        STWSandboxMappingStore::setSharedInstance(store);
        cache = std::make_shared<STWContainerCache>(STWUserIdentitySharedCache::sharedInstance());
        mobile = STWTestPersonalIdentity();
        enterprise = STWTestEnterpriseIdentity();
    }

    // Every entry below `top` (links not followed) except the store's own tree.
    std::set<fs::path> entries(const fs::path& top, bool skipStore) {
        std::set<fs::path> found;
        for (auto it = fs::recursive_directory_iterator(top); it != fs::recursive_directory_iterator(); ++it) {
            if (skipStore && it->path() == base) {
                it.disable_recursion_pending();
                continue;
            }
            found.insert(it->path());
        }
        return found;
    }
    std::set<fs::path> links() {
        std::set<fs::path> found;
        if (fs::exists(base))
            for (const fs::path& p : entries(base, false))
                if (fs::is_symlink(p))
                    found.insert(p);
        return found;
    }
    bool add(const STWTestContainer& container, bool transient = false) {
        STWErrorRef error;
        bool added = cache->addContainerMetadata(container.metadata, container.url, transient, true, &error);
        EXPECT_TRUE(added) << (error ? error->description() : "");
        return added;
    }
    bool remove(const STWTestContainer& container) {
        STWErrorRef error;
        return cache->removeContainerForUserIdentity(container.metadata->userIdentity(),
                                                     container.metadata->containerClass(),
                                                     container.metadata->identifier(), false, &error);
    }

    fs::path base;
    std::shared_ptr<STWFileSandboxMappingStore> store;
    std::shared_ptr<STWContainerCache> cache;
    STWUserIdentityRef mobile, enterprise;
};

TEST_F(STWSandboxMappingTest, MappingsArePushedOnAddAndWithdrawnOnRemove) {
    auto data = STWMakeTestContainer(mobile, "com.example.app", 2);
    auto group = STWMakeTestContainer(enterprise, "group.com.work", 7);
    auto system = STWMakeTestContainer(STWUserIdentityCache::defaultUserIdentity(), "com.example.sys", 12);
    ASSERT_TRUE(add(data) && add(group) && add(system));

    // Items go by the kernel persona id (PERSONAL is 1000, ENT-1 1001); the default identity
    // has no persona data and goes by its user id; system containers map for user 0.
    const std::set<fs::path> expected{base / "501/1000/1/com.example.app", base / "501/1001/2/group.com.work",
                                      base / "0/501/4/com.example.sys"};
    EXPECT_EQ(links(), expected);
    EXPECT_EQ(fs::read_symlink(base / "501/1000/1/com.example.app"), data.url);
    EXPECT_EQ(fs::read_symlink(base / "0/501/4/com.example.sys"), system.url);

    // Re-adding at a new place re-points the mapping.
    auto moved = STWMakeTestContainer(mobile, "com.example.app", 2);
    ASSERT_TRUE(add(moved));
    EXPECT_EQ(fs::read_symlink(base / "501/1000/1/com.example.app"), moved.url);

    EXPECT_TRUE(remove(data) && remove(group) && remove(system));
    EXPECT_TRUE(links().empty());
    // Withdrawing what is not there is no failure.
    EXPECT_TRUE(store->setUserStateItem({501, 1000, 1, "com.never.pushed"}, std::nullopt, nullptr));

    // No mapping for: a bundle, a transient container, an enterprise identity's container of
    // a bundle it shares with the personal persona, a personal container of an
    // enterprise-only bundle.
    ASSERT_TRUE(add(STWMakeTestContainer(STWUserIdentityCache::defaultUserIdentity(), "com.example.app", 1)));
    ASSERT_TRUE(add(STWMakeTestContainer(mobile, "com.example.temp", 2, true), true));
    ASSERT_TRUE(add(STWMakeTestContainer(enterprise, "com.shared.app", 2)));
    ASSERT_TRUE(add(STWMakeTestContainer(mobile, "com.work.mail", 2)));
    EXPECT_TRUE(links().empty());
    // The owners do get theirs.
    ASSERT_TRUE(add(STWMakeTestContainer(enterprise, "com.work.mail", 4)));
    ASSERT_TRUE(add(STWMakeTestContainer(mobile, "com.shared.app", 11)));
    EXPECT_EQ(links(), (std::set<fs::path>{base / "501/1001/1/com.work.mail", base / "501/1000/1/com.shared.app"}));
}

// What a restart finds in the store: the rebuild leaves the links that are right as they
// are and repairs the others, one link per container.
TEST_F(STWSandboxMappingTest, ARebuildKeepsCurrentLinksAndRepairsTheOthers) {
    auto current = STWMakeTestContainer(mobile, "com.example.current", 2);
    auto escaped = STWMakeTestContainer(mobile, "../escaped", 2);
    auto wrong = STWMakeTestContainer(mobile, "com.example.wrong", 2);
    auto longer = STWMakeTestContainer(mobile, "com.example.longer", 2);
    auto missing = STWMakeTestContainer(mobile, "com.example.missing", 2);
    fs::path directory = base / "501/1000/1";
    auto link = [&](const STWTestContainer& container) {
        return directory / STWSandboxMappingStore::nameForIdentifier(container.metadata->identifier());
    };
    fs::create_directories(directory);
    fs::create_symlink(current.url, link(current));
    fs::create_symlink(escaped.url, link(escaped));
    fs::create_symlink(current.url, link(wrong));
    fs::create_symlink(longer.url.string() + "-old", link(longer));
    // Held open, the links that must stay keep their inode numbers from new links.
    std::vector<std::pair<fs::path, STWFileDescriptor>> kept;
    for (const STWTestContainer* container : {&current, &escaped})
        kept.emplace_back(link(*container), open(link(*container).c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));

    STWErrorRef error;
    ASSERT_TRUE(cache->containerForContainerIdentity(
        STWContainerIdentity::containerIdentityWithUserIdentity(mobile, "com.example.missing", 2, nullptr), false,
        true, &error));
    std::set<fs::path> expected;
    for (const STWTestContainer* container : {&current, &escaped, &wrong, &longer, &missing}) {
        EXPECT_EQ(fs::read_symlink(link(*container)), container->url) << container->metadata->identifier();
        expected.insert(link(*container));
    }
    EXPECT_EQ(links(), expected);
    for (const auto& [path, fd] : kept) {
        struct stat held, now;
        ASSERT_TRUE(fstat(fd.get(), &held) == 0 && lstat(path.c_str(), &now) == 0) << path;
        EXPECT_EQ(held.st_ino, now.st_ino) << path << " was made again";
    }
}

TEST_F(STWSandboxMappingTest, IdentifiersThatAreNoFileNameAreStoredEscapedAndNeverClimb) {
    auto container = STWMakeTestContainer(mobile, "com.example.app", 2);
    // A container whose metadata names a path as its identifier.
    auto escaping = STWMakeTestContainer(mobile, "../../../../../../escape", 2);
    ASSERT_TRUE(add(container));
    const fs::path& root = STWTestRoot::shared().path();
    std::set<fs::path> before = entries(root, true);
    fs::path directory = base / "501/1000/1";

    const std::string hostile[] = {"", ".", "..", "../../../../etc/passwd", "a/b", "/abs", std::string("a\0b", 3),
                                   std::string(256, 'x'), "%escaped", ".hidden"};
    std::set<std::string> names;
    for (const std::string& identifier : hostile) {
        STWSandboxMappingItem item{501, 1000, 1, identifier};
        ASSERT_TRUE(store->setUserStateItem(item, container.url, nullptr)) << identifier;
        EXPECT_EQ(store->userStateItem(item), container.url);
        std::string name = STWSandboxMappingStore::nameForIdentifier(identifier);
        EXPECT_EQ(name.size(), 65u);
        EXPECT_EQ(name[0], '%');
        EXPECT_EQ(fs::read_symlink(directory / name), container.url);
        names.insert(name);
    }
    EXPECT_EQ(names.size(), std::size(hostile)) << "one name per identifier";
    // Plain names, odd as they may be, are stored as they are.
    for (const char* odd : {"a..b", "with space", "caf\xc3\xa9", "-", "a%b"}) {
        STWSandboxMappingItem item{501, 1000, 1, odd};
        ASSERT_TRUE(store->setUserStateItem(item, container.url, nullptr)) << odd;
        EXPECT_EQ(fs::read_symlink(directory / odd), container.url);
    }
    // Its mapping lives inside the store too.
    ASSERT_TRUE(add(escaping));
    EXPECT_EQ(store->userStateItem({501, 1000, 1, "../../../../../../escape"}), escaping.url);
    EXPECT_TRUE(remove(escaping));
    EXPECT_EQ(entries(root, true), before);
}

TEST_F(STWSandboxMappingTest, LinksPlantedInTheStoreAreNeverFollowed) {
    fs::path outside = STWTestRoot::shared().resolve("/private/var/outside");
    fs::create_directories(outside / "1");
    std::ofstream(outside / "1/com.example.app") << "victim";
    fs::create_directories(base / "501");
    fs::create_directory_symlink(outside, base / "501/1000");

    STWSandboxMappingItem item{501, 1000, 1, "com.example.app"};
    for (const std::optional<fs::path>& path :
         {std::optional<fs::path>("/somewhere"), std::optional<fs::path>()}) {
        STWErrorRef error;
        EXPECT_FALSE(store->setUserStateItem(item, path, &error));
        ASSERT_TRUE(error);
        EXPECT_TRUE(error->isPOSIX(ELOOP) || error->isPOSIX(ENOTDIR)) << error->description();
    }
    auto container = STWMakeTestContainer(mobile, "com.example.app", 2);
    ASSERT_TRUE(add(container)); // the failed push is logged, not returned
    EXPECT_TRUE(remove(container));
    EXPECT_TRUE(fs::is_regular_file(fs::symlink_status(outside / "1/com.example.app")));
    EXPECT_EQ(entries(outside, false), (std::set<fs::path>{outside / "1", outside / "1/com.example.app"}));

    // A link in the identifier's place is replaced, never written through.
    fs::remove(base / "501/1000");
    fs::create_directories(base / "501/1000/1");
    fs::create_symlink(outside / "1/com.example.app", base / "501/1000/1/com.example.app");
    ASSERT_TRUE(add(container));
    EXPECT_EQ(fs::read_symlink(base / "501/1000/1/com.example.app"), container.url);
    std::string content;
    std::ifstream(outside / "1/com.example.app") >> content;
    EXPECT_EQ(content, "victim");

    // Whoever clears the runtime directory takes the directories the store keeps open: the
    // store is built again.
    const fs::path cleared("/private/var/mobile/Containers/Data/Application/A");
    ASSERT_TRUE(store->setUserStateItem(item, cleared, nullptr));
    fs::remove_all(base);
    EXPECT_EQ(store->userStateItem(item), std::nullopt);
    EXPECT_TRUE(store->setUserStateItem(item, std::nullopt, nullptr));
    ASSERT_TRUE(store->setUserStateItem(item, cleared, nullptr));
    EXPECT_EQ(fs::read_symlink(base / "501/1000/1/com.example.app"), cleared);
    EXPECT_EQ(store->userStateItem(item), cleared);
    EXPECT_TRUE(store->setUserStateItem(item, std::nullopt, nullptr));
    EXPECT_FALSE(fs::exists(fs::symlink_status(base / "501/1000/1/com.example.app")));
}

TEST_F(STWSandboxMappingTest, ReplacingAMappingNeverLeavesItMissing) {
    STWSandboxMappingItem item{501, 1000, 1, "com.example.app"};
    const fs::path paths[] = {"/private/var/mobile/Containers/Data/Application/A",
                              "/private/var/mobile/Containers/Data/Application/B"};
    ASSERT_TRUE(store->setUserStateItem(item, paths[0], nullptr));
    std::atomic<bool> done{false};
    std::atomic<int> missing{0}, seen{0};
    std::thread reader([&] {
        while (!done) {
            auto path = store->userStateItem(item);
            if (!path || (*path != paths[0] && *path != paths[1]))
                missing++;
            seen++;
        }
    });
    std::thread second([&] {
        for (int i = 0; i < 500; ++i)
            EXPECT_TRUE(store->setUserStateItem(item, paths[i % 2], nullptr));
    });
    for (int i = 0; i < 500; ++i)
        EXPECT_TRUE(store->setUserStateItem(item, paths[(i + 1) % 2], nullptr));
    second.join();
    done = true;
    reader.join();
    EXPECT_GT(seen, 0);
    EXPECT_EQ(missing, 0);
    // No temporary link is left behind.
    EXPECT_EQ(entries(base / "501/1000/1", false), std::set<fs::path>{base / "501/1000/1/com.example.app"});
}

} // namespace

#include "platform/STWKeybag.h"
#include "tests/filesystem/STWFileSystemTestSupport.h"
#include "tests/support/STWTestRoot.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <map>
#include <sys/stat.h>
#include <unistd.h>

namespace fs = std::filesystem;
using namespace stwtest;

namespace {

class Items : public FileSystemTest {
protected:
    void TearDown() override {
        STWKeybag::setLockStateOverrideForTesting(std::nullopt);
        FileSystemTest::TearDown();
    }
    // The item's protection class, or nullopt when it cannot be read.
    std::optional<int32_t> classOf(const fs::path& path) {
        int32_t value = -1;
        return fm()->dataProtectionClassOfItemAtURL(path, &value) ? std::optional(value) : std::nullopt;
    }
};

TEST_F(Items, ListingHidesDotNamesAndTypesLinksAsWhatTheyAre) {
    fs::create_directory(scratch() / "dir");
    fs::create_directory(scratch() / ".hidden-dir");
    writeFile(scratch() / "file", "");
    writeFile(scratch() / ".metadata", "");
    fs::create_symlink("nowhere", scratch() / "dangling");

    auto items = fm()->urlsForItemsInDirectoryAtURL(scratch());
    ASSERT_TRUE(items);
    std::vector<fs::path> sorted = *items;
    std::sort(sorted.begin(), sorted.end());
    EXPECT_EQ(sorted, (std::vector<fs::path>{scratch() / "dangling", scratch() / "dir", scratch() / "file"}));

    // The typed listing: only a real directory is one, not a link to it.
    fs::create_directory_symlink(scratch() / "dir", scratch() / "link-to-dir");
    auto typed = fm()->itemsInDirectoryAtURL(scratch());
    ASSERT_TRUE(typed);
    std::map<std::string, bool> types;
    for (const auto& item : *typed)
        types[item.name] = item.isDirectory;
    EXPECT_EQ(types, (std::map<std::string, bool>{
                         {"dangling", false}, {"dir", true}, {"file", false}, {"link-to-dir", false}}));
}

TEST_F(Items, ExistenceOfDanglingLinksAndOfItemsThatCannotBeExamined) {
    fs::create_symlink("nowhere", scratch() / "dangling");
    EXPECT_TRUE(fm()->itemExistsAtURL(scratch() / "dangling"));
    EXPECT_FALSE(fm()->itemDoesNotExistAtURL(scratch() / "dangling"));
    EXPECT_FALSE(fm()->itemExistsAtURL(scratch() / "missing"));
    EXPECT_TRUE(fm()->itemDoesNotExistAtURL(scratch() / "missing"));

    if (geteuid() != 0)
        GTEST_SKIP() << "needs root to drop to another user";
    fs::create_directory(scratch() / "closed");
    writeFile(scratch() / "closed/item", "");
    ASSERT_EQ(chmod((scratch() / "closed").c_str(), 0700), 0);
    int result = runAs(kNobody, kNobody, [&] {
        auto* manager = STWFileManager::defaultManager();
        bool exists = manager->itemExistsAtURL(scratch() / "closed/item");
        bool doesNotExist = manager->itemDoesNotExistAtURL(scratch() / "closed/item");
        return !exists && !doesNotExist ? 0 : 1;
    });
    EXPECT_EQ(result, 0) << "an item that cannot be examined neither exists nor does not exist";
}

TEST_F(Items, ClassPredicateDecidesAndLinksAreNeverFollowedForClassOrOwner) {
    fs::path file = scratch() / "file";
    writeFile(file, "x");
    EXPECT_EQ(classOf(file), 0) << "no class yet";

    ASSERT_TRUE(fm()->setDataProtectionClassOfItemAtURL(file, 3, nullptr));
    std::vector<int32_t> seen;
    EXPECT_TRUE(fm()->setDataProtectionClassOfItemAtURL(file, 4, [&](int32_t current) {
        seen.push_back(current);
        return false;
    }));
    EXPECT_EQ(classOf(file), 3) << "a predicate answering NO changes nothing";
    EXPECT_TRUE(fm()->setDataProtectionClassOfItemAtURL(file, 4, [&](int32_t current) {
        seen.push_back(current);
        return current != 4;
    }));
    EXPECT_EQ(classOf(file), 4);
    EXPECT_EQ(seen, (std::vector<int32_t>{3, 3}));

    fs::create_symlink(file, scratch() / "link");
    STWErrorRef error;
    EXPECT_FALSE(fm()->setDataProtectionClassOfItemAtURL(scratch() / "link", 1, nullptr, &error));
    EXPECT_TRUE(error && error->isPOSIX(ELOOP));
    EXPECT_EQ(classOf(file), 4);

    // Nor are owner and class given to the target of a link planted where a directory is made.
    fs::path target = scratch() / "target";
    fs::create_directory(target);
    fs::create_directory_symlink(target, scratch() / "planted");
    uid_t owner = lstatOf(target).st_uid;
    error.reset();
    EXPECT_FALSE(fm()->createDirectoryAtURL(scratch() / "planted", true, 0755, 501, 3, &error));
    EXPECT_TRUE(error && (error->isPOSIX(ELOOP) || error->isPOSIX(ENOTDIR)));
    EXPECT_EQ(lstatOf(target).st_uid, owner);
    EXPECT_EQ(classOf(target), 0);
}

// What each refusal while locked reports is in the reporting tests.
TEST_F(Items, OnlyClassOneIsOutOfReachWhileLocked) {
    fs::path complete = scratch() / "complete", other = scratch() / "other";
    writeFile(complete, "c");
    writeFile(other, "o");
    ASSERT_TRUE(fm()->setDataProtectionClassOfItemAtURL(complete, 1, nullptr));
    ASSERT_TRUE(fm()->setDataProtectionClassOfItemAtURL(other, 3, nullptr));
    STWKeybag::setLockStateOverrideForTesting(true);
    EXPECT_FALSE(fm()->setDataProtectionClassOfItemAtURL(other, 1, nullptr));
    EXPECT_TRUE(fm()->setDataProtectionClassOfItemAtURL(other, 4, nullptr));
    STWKeybag::setLockStateOverrideForTesting(false);
    EXPECT_EQ(classOf(complete), 1);
}

TEST_F(Items, CreatingAnExistingDirectoryStillSetsOwnerAndClass) {
    fs::path dir = scratch() / "a/b/c";
    ASSERT_TRUE(fm()->createDirectoryAtURL(dir, true, 0750));
    EXPECT_EQ(fs::status(dir).permissions() & fs::perms::all, fs::perms(0750));
    // Intermediate directories can always be written and searched by their owner, or
    // nothing could be made below them.
    ASSERT_TRUE(fm()->createDirectoryAtURL(scratch() / "r/s/t", true, 0500));
    for (auto [path, mode] : {std::pair{"r", 0700}, {"r/s", 0700}, {"r/s/t", 0500}})
        EXPECT_EQ(fs::status(scratch() / path).permissions() & fs::perms::all, fs::perms(mode)) << path;

    STWErrorRef error;
    ASSERT_TRUE(fm()->createDirectoryAtURL(dir, true, 0700, 501, 4, &error)) << error->description();
    struct stat st;
    ASSERT_EQ(stat(dir.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0750u) << "an existing directory keeps its mode";
    if (geteuid() == 0) {
        EXPECT_EQ(st.st_uid, 501u);
        EXPECT_EQ(st.st_gid, 501u) << "one id serves as user and group";
    }
    EXPECT_EQ(classOf(dir), 4);

    // A file in the way is not a directory, with or without intermediate directories.
    writeFile(scratch() / "file", "");
    for (bool intermediates : {false, true}) {
        error.reset();
        EXPECT_FALSE(fm()->createDirectoryAtURL(scratch() / "file", intermediates, 0755, &error));
        EXPECT_TRUE(error && error->isPOSIX(ENOTDIR)) << intermediates;
    }
}

// What `du -s -x --block-size=1` says, or nullopt where it cannot be run.
std::optional<uint64_t> duBytes(const fs::path& path) {
    std::string command = "du -s -x --block-size=1 '" + path.native() + "' 2>/dev/null";
    FILE* pipe = popen(command.c_str(), "r");
    if (!pipe)
        return std::nullopt;
    unsigned long long bytes = 0;
    int fields = fscanf(pipe, "%llu", &bytes);
    return pclose(pipe) == 0 && fields == 1 ? std::optional<uint64_t>(bytes) : std::nullopt;
}

TEST_F(Items, DiskUsageCountsAllocatedBytesLikeDu) {
    fs::path tree = scratch() / "tree";
    fs::create_directories(tree / "a/b");
    writeFile(tree / "a/small", "x");
    writeFile(tree / "a/b/large", std::string(1 << 20, 'l'));
    ASSERT_EQ(link((tree / "a/b/large").c_str(), (tree / "hardlink").c_str()), 0);
    fs::create_symlink("a/b/large", tree / "symlink");
    // A sparse file: its size is not what it occupies.
    writeFile(tree / "sparse", "s");
    ASSERT_EQ(truncate((tree / "sparse").c_str(), 50 << 20), 0);
    // Another file system mounted inside is not counted.
    std::optional<ScopedTmpfs> mount;
    mount.emplace(tree / "a/mnt");
    if (mount->mounted())
        writeFile(tree / "a/mnt/elsewhere", std::string(4 << 20, 'e'));
    else
        mount.reset();
    auto expected = duBytes(tree);
    if (!expected)
        GTEST_SKIP() << "du is not available";
    EXPECT_EQ(fm()->diskUsageForURL(tree), *expected);
    EXPECT_LT(fm()->diskUsageForURL(tree), 3u << 20);

    STWTestRoot::shared().writeSettings(
        {{"Features", STWValue(STWValue::Dictionary{{"fast_container_sizing", STWValue(true)}})}});
    EXPECT_EQ(fm()->fastDiskUsageForURL(tree), *expected);
    STWTestRoot::shared().writeSettings({});
    EXPECT_EQ(fm()->fastDiskUsageForURL(tree), *expected);

    EXPECT_EQ(fm()->diskUsageForURL(scratch() / "missing"), 0u);
    EXPECT_EQ(fm()->diskUsageForURL(""), 0u);
}

} // namespace

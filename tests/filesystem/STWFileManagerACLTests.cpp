#include "tests/filesystem/STWFileSystemTestSupport.h"
#include "tests/support/STWTestRoot.h"

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <fcntl.h>
#include <fstream>
#include <thread>

namespace fs = std::filesystem;
using namespace stwtest;

namespace {

// The test root's group database gives "systemusers" 950 and has no "nobody" entries.
constexpr const char* kItemACL = "u::---,g::---,g:950:rwx,m::rwx,o::---";
constexpr const char* kMetadata = ".com.vorlane.stowly.metadata.plist";

// What a walk must not change: owner, mode and ACL.
std::string fingerprint(const fs::path& path) {
    struct stat st = lstatOf(path);
    std::string text =
        std::to_string(st.st_uid) + ":" + std::to_string(st.st_gid) + ":" + std::to_string(st.st_mode);
    if (!S_ISLNK(st.st_mode))
        text += ":" + aclText(path, ACL_TYPE_ACCESS);
    return text;
}

class STWFileManagerACLTest : public FileSystemTest {
protected:
    void SetUp() override {
        FileSystemTest::SetUp();
        writeFile(scratch() / "probe", "");
        acl_t acl = acl_from_text("u::rw-,g::r--,g:950:rwx,m::rwx,o::---");
        int r = acl_set_file((scratch() / "probe").c_str(), ACL_TYPE_ACCESS, acl);
        int e = errno;
        acl_free(acl);
        fs::remove(scratch() / "probe");
        if (r != 0)
            GTEST_SKIP() << "The file system of " << scratch() << " has no POSIX ACLs: " << strerror(e);
    }

    // A container: files, directories, a FIFO, an inner link, a pair of hard links and
    // metadata files (one with an ACL of its own) at the root and in a subdirectory.
    fs::path makeContainer(const std::string& name) {
        fs::path c = scratch() / name;
        fs::create_directories(c / "Library/Preferences");
        writeFile(c / "a", "a", 0600);
        writeFile(c / "tool", "t", 0700);
        writeFile(c / "Library/Preferences/p.plist", "p", 0640);
        fs::create_hard_link(c / "a", c / "Library/a-link");
        fs::create_symlink("a", c / "inner-link");
        EXPECT_EQ(mkfifo((c / "pipe").c_str(), 0644), 0);
        writeFile(c / kMetadata, "m", 0644);
        setACLText(c / kMetadata, "u::rw-,g::r--,u:501:r--,m::r--,o::r--");
        writeFile(c / "Library" / kMetadata, "m", 0600);
        return c;
    }
};

TEST_F(STWFileManagerACLTest, SystemContainerWalkGivesEveryItemTheGroupEntryAndTheRootTheTopLevelACL) {
    fs::path c = makeContainer("system");
    fs::permissions(c, fs::perms(0755));
    // An item that cannot be changed is passed over; the rest is still done.
    writeFile(c / "Library/locked", "l", 0644);
    setImmutable(c / "Library/locked", true);
    std::string metadata = fingerprint(c / kMetadata), nested = fingerprint(c / "Library" / kMetadata);

    for (int pass = 0; pass < 2; ++pass) { // a second walk finds nothing to change
        STWErrorRef error;
        ASSERT_TRUE(fm()->standardizeACLsForSystemContainerAtURL(c, &error))
            << (error ? error->description() : "");
        for (const char* item : {"a", "tool", "pipe", "Library", "Library/Preferences",
                                 "Library/Preferences/p.plist", "Library/a-link", "inner-link"}) {
            struct stat st = lstatOf(c / item);
            EXPECT_EQ(st.st_uid, kNobody) << item;
            EXPECT_EQ(st.st_gid, kNobody) << item;
            if (S_ISLNK(st.st_mode))
                continue;
            // Owner and other bits empty; the group bits are the ACL's mask.
            EXPECT_EQ(st.st_mode & 07707, 0u) << item;
            EXPECT_EQ(aclText(c / item, ACL_TYPE_ACCESS), kItemACL) << item;
            if (S_ISDIR(st.st_mode)) {
                EXPECT_EQ(aclText(c / item, ACL_TYPE_DEFAULT), kItemACL) << item;
            }
        }
        struct stat root = lstatOf(c);
        EXPECT_EQ(root.st_uid, 0u);
        EXPECT_EQ(root.st_mode & 0707, 0705u);
        EXPECT_EQ(aclText(c, ACL_TYPE_ACCESS), "u::rwx,g::r-x,g:950:-wx,m::rwx,o::r-x");
        EXPECT_EQ(aclText(c, ACL_TYPE_DEFAULT), kItemACL);
        EXPECT_EQ(fingerprint(c / kMetadata), metadata);
        EXPECT_EQ(fingerprint(c / "Library" / kMetadata), nested);
    }

    // Staged content: the root is an item like the others.
    fs::path staged = makeContainer("staged");
    ASSERT_TRUE(fm()->standardizeACLsAtURL(staged, false));
    EXPECT_EQ(aclText(staged, ACL_TYPE_ACCESS), kItemACL);
    EXPECT_EQ(lstatOf(staged).st_uid, kNobody);
    writeFile(scratch() / "single", "s", 0644);
    ASSERT_TRUE(fm()->standardizeACLsAtURL(scratch() / "single", false));
    EXPECT_EQ(aclText(scratch() / "single", ACL_TYPE_ACCESS), kItemACL);
}

TEST_F(STWFileManagerACLTest, AllSystemContainersAndAMissingGroup) {
    EXPECT_TRUE(fm()->standardizeAllSystemContainerACLsAtURL(scratch() / "missing"));
    fs::create_directories(scratch() / "containers");
    fs::path one = makeContainer("containers/one"), two = makeContainer("containers/two");
    ASSERT_TRUE(fm()->standardizeAllSystemContainerACLsAtURL(scratch() / "containers"));
    EXPECT_EQ(aclText(one / "a", ACL_TYPE_ACCESS), kItemACL);
    EXPECT_EQ(aclText(two / "Library", ACL_TYPE_DEFAULT), kItemACL);

    // Without the group nothing is changed and the walk fails with its code.
    fs::path groups = STWTestRoot::shared().resolve("/etc/group");
    std::string saved = readFile(groups);
    std::ofstream(groups) << "root:x:0:\nmobile:x:501:\n";
    fs::path three = makeContainer("containers/three");
    std::string before = fingerprint(three / "a");
    STWErrorRef error;
    bool ok = fm()->standardizeACLsForSystemContainerAtURL(three, &error);
    std::ofstream(groups) << saved;
    EXPECT_FALSE(ok);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code(), 63);
    EXPECT_EQ(fingerprint(three / "a"), before);
}

TEST_F(STWFileManagerACLTest, OwnershipWalkSetsOwnerAndModesButLeavesTheMetadataFileAlone) {
    fs::path c = makeContainer("data");
    fs::permissions(c / "Library", fs::perms(0700));
    std::string metadata = fingerprint(c / kMetadata), nested = fingerprint(c / "Library" / kMetadata);
    ASSERT_TRUE(fm()->standardizeOwnershipAtURL(c, 501, 501));
    const std::pair<const char*, mode_t> modes[] = {{"", 0755},        {"a", 0644},
                                                    {"tool", 0755},    {"pipe", 0644},
                                                    {"Library", 0755}, {"Library/Preferences/p.plist", 0644}};
    for (auto [item, mode] : modes) {
        struct stat st = lstatOf(c / item);
        EXPECT_EQ(st.st_mode & 07777, mode) << item;
        EXPECT_EQ(st.st_uid, 501u) << item;
        EXPECT_EQ(st.st_gid, 501u) << item;
    }
    EXPECT_EQ(lstatOf(c / "inner-link").st_uid, 501u);
    EXPECT_EQ(fingerprint(c / kMetadata), metadata);
    EXPECT_EQ(fingerprint(c / "Library" / kMetadata), nested);
}

// The app owns the tree and rearranges it while we walk (links out, a FIFO, a loop, a hard link
// out, a directory swapped for a link over and over): nothing outside changes, the walks end.
TEST_F(STWFileManagerACLTest, HostileTreeNeverLeadsAWalkOutside) {
    fs::path outside = scratch() / "outside";
    fs::create_directories(outside / "dir");
    writeFile(outside / "secret", "s", 0640);
    writeFile(outside / "dir/file", "f", 0600);
    setACLText(outside / "secret", "u::rw-,g::r--,u:501:r--,m::r--,o::---");
    const std::vector<fs::path> watched = {outside, outside / "dir", outside / "secret",
                                           outside / "dir/file"};
    std::vector<std::string> before;
    for (const fs::path& p : watched)
        before.push_back(fingerprint(p));

    fs::path c = scratch() / "hostile";
    fs::create_directories(c / "swap");
    writeFile(c / "swap/inner", "i");
    fs::create_directory_symlink(outside, c / "escape");
    fs::create_directory_symlink(outside / "dir", c / "swap-link");
    fs::create_symlink(outside / "secret", c / "secret-link");
    fs::create_symlink("loop2", c / "loop1");
    fs::create_symlink("loop1", c / "loop2");
    fs::create_hard_link(outside / "secret", c / "hard");
    ASSERT_EQ(mkfifo((c / "fifo").c_str(), 0600), 0);

    std::atomic<bool> stop{false};
    std::thread swapper([&] {
        while (!stop.load())
            renameat2(AT_FDCWD, (c / "swap").c_str(), AT_FDCWD, (c / "swap-link").c_str(), RENAME_EXCHANGE);
    });
    for (int round = 0; round < 200; ++round) {
        fm()->standardizeACLsForSystemContainerAtURL(c);
        fm()->standardizeACLsAtURL(c, false);
        fm()->standardizeOwnershipAtURL(c, 501, 501);
    }
    stop = true;
    swapper.join();

    for (size_t i = 0; i < watched.size(); ++i)
        EXPECT_EQ(fingerprint(watched[i]), before[i]) << watched[i];
    EXPECT_EQ(lstatOf(c / "fifo").st_uid, 501u); // the FIFO itself was changed, without blocking
}

} // namespace

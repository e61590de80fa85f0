#include "tests/filesystem/STWFileSystemTestSupport.h"

#include <cerrno>
#include <sys/xattr.h>
#include <unistd.h>

#include <map>
#include <mutex>
#include <vector>

namespace fs = std::filesystem;
using namespace stwtest;

namespace {

std::map<std::string, std::string> attributes(const fs::path& path) {
    std::map<std::string, std::string> result;
    char names[4096];
    ssize_t size = llistxattr(path.c_str(), names, sizeof names);
    for (ssize_t offset = 0; offset < size;) {
        std::string name = names + offset;
        offset += static_cast<ssize_t>(name.size()) + 1;
        char value[256];
        ssize_t n = lgetxattr(path.c_str(), name.c_str(), value, sizeof value);
        if (n >= 0)
            result[name] = std::string(value, static_cast<size_t>(n));
    }
    return result;
}

void setAttribute(const fs::path& path, const char* name, const std::string& value) {
    ASSERT_EQ(lsetxattr(path.c_str(), name, value.data(), value.size(), 0), 0)
        << name << ": " << strerror(errno);
}

// A tree with everything a copy must carry over.
void buildRichTree(const fs::path& src) {
    fs::create_directories(src / "dir/nested");
    writeFile(src / "file", "contents", 0640);
    writeFile(src / "dir/nested/deep", std::string(300000, 'd'), 0600);
    fs::permissions(src / "dir", fs::perms(0711));
    setAttribute(src / "file", "user.note", "hello");
    setAttribute(src / "file", "trusted.stowly.protection-class", std::string("\3\0\0\0", 4));
    setAttribute(src / "dir", "user.dir", "d");
    setACLText(src / "file", "u::rw-,g::r--,g:950:rwx,m::rwx,o::---");
    setACLText(src / "dir", "u::rwx,g::r-x,g:950:rwx,m::rwx,o::---", ACL_TYPE_DEFAULT);
    fs::create_symlink("file", src / "link");
    fs::create_symlink("missing-target", src / "dangling");
    ASSERT_EQ(mkfifo((src / "dir/fifo").c_str(), 0640), 0);
    if (geteuid() == 0) {
        ASSERT_EQ(lchown((src / "file").c_str(), 501, 502), 0);
        ASSERT_EQ(lchown((src / "link").c_str(), 502, 501), 0);
        ASSERT_EQ(lchown((src / "dir").c_str(), 501, 501), 0);
    }
}

void expectSameTree(const fs::path& src, const fs::path& dst) {
    EXPECT_EQ(readFile(dst / "file"), "contents");
    EXPECT_EQ(readFile(dst / "dir/nested/deep"), readFile(src / "dir/nested/deep"));
    for (const char* item :
         {"file", "dir", "dir/nested", "dir/nested/deep", "dir/fifo", "link", "dangling"}) {
        struct stat a = lstatOf(src / item), b = lstatOf(dst / item);
        EXPECT_EQ(a.st_mode, b.st_mode) << item;
        EXPECT_EQ(a.st_uid, b.st_uid) << item;
        EXPECT_EQ(a.st_gid, b.st_gid) << item;
        EXPECT_NE(a.st_ino, b.st_ino) << item;
    }
    EXPECT_EQ(attributes(dst / "file"), attributes(src / "file"));
    EXPECT_EQ(attributes(dst / "file").count("trusted.stowly.protection-class"), 1u);
    EXPECT_EQ(attributes(dst / "dir"), attributes(src / "dir"));
    EXPECT_EQ(aclText(dst / "file", ACL_TYPE_ACCESS), aclText(src / "file", ACL_TYPE_ACCESS));
    EXPECT_NE(aclText(dst / "file", ACL_TYPE_ACCESS).find("g:950:rwx"), std::string::npos);
    EXPECT_EQ(aclText(dst / "dir", ACL_TYPE_DEFAULT), aclText(src / "dir", ACL_TYPE_DEFAULT));
    EXPECT_EQ(fs::read_symlink(dst / "link"), "file");
    EXPECT_EQ(fs::read_symlink(dst / "dangling"), "missing-target");
}

class CopyMove : public FileSystemTest {};

TEST_F(CopyMove, CopyCarriesDataModesOwnersAttributesACLsAndLinks) {
    fs::path src = scratch() / "src";
    ASSERT_NO_FATAL_FAILURE(buildRichTree(src));
    STWErrorRef error;
    ASSERT_TRUE(fm()->copyItemAtURL(src, scratch() / "dst", &error)) << error->description();
    expectSameTree(src, scratch() / "dst");
    // The source is untouched.
    EXPECT_EQ(readFile(src / "file"), "contents");
}

TEST_F(CopyMove, CopyNeverFollowsLinksAtSourceOrDestination) {
    fs::path outside = scratch() / "outside";
    fs::create_directory(outside);
    writeFile(outside / "secret", "s");
    fs::path src = scratch() / "src";
    fs::create_directory(src);
    fs::create_directory_symlink(outside, src / "escape");
    writeFile(src / "payload", "attacker");

    ASSERT_TRUE(fm()->copyItemAtURL(src, scratch() / "dst"));
    EXPECT_TRUE(fs::is_symlink(scratch() / "dst/escape"));
    EXPECT_FALSE(fs::exists(scratch() / "dst/secret"));

    // A link planted where a file is to be copied is not written through.
    fs::create_symlink(outside / "secret", scratch() / "planted");
    STWErrorRef error;
    EXPECT_FALSE(fm()->copyItemAtURL(src / "payload", scratch() / "planted", &error));
    EXPECT_TRUE(error && error->isPOSIX(ELOOP));
    EXPECT_EQ(readFile(outside / "secret"), "s");
}

// The plain forms fail with ENOENT in the reporting tests.
TEST_F(CopyMove, MissingSourceIsNoErrorForTheIfExistsForms) {
    EXPECT_TRUE(fm()->copyItemIfExistsAtURL(scratch() / "missing", scratch() / "c"));
    EXPECT_TRUE(
        fm()->moveItemIfExistsAtURL(scratch() / "missing", scratch() / "m", STWFileManagerMoveDurable));
    EXPECT_TRUE(fs::is_empty(scratch()));
}

TEST_F(CopyMove, MoveAcrossFileSystemsCopiesDurablyThenRemovesWhatItCanOfTheSource) {
    ScopedTmpfs tmpfs(scratch() / "mnt");
    if (!tmpfs.mounted())
        GTEST_SKIP() << "cannot mount a tmpfs here: " << tmpfs.failure();
    fs::path src = scratch() / "src";
    ASSERT_NO_FATAL_FAILURE(buildRichTree(src));
    fs::path reference = scratch() / "reference";
    ASSERT_TRUE(fm()->copyItemAtURL(src, reference));

    std::vector<std::string> synced;
    std::mutex mutex;
    STWFileManager::setSyncObserverForTesting([&](const std::string& path) {
        std::lock_guard guard(mutex);
        synced.push_back(path);
    });
    STWErrorRef error;
    bool moved = fm()->moveItemAtURL(src, scratch() / "mnt/moved", STWFileManagerMoveDurable, &error);
    STWFileManager::setSyncObserverForTesting(nullptr);
    ASSERT_TRUE(moved) << error->description();
    EXPECT_FALSE(fs::exists(fs::symlink_status(src)));
    expectSameTree(reference, scratch() / "mnt/moved");
    // The copy itself was made durable before the source went.
    EXPECT_NE(std::find(synced.begin(), synced.end(), (scratch() / "mnt/moved/dir/nested/deep").native()),
              synced.end());
    EXPECT_NE(std::find(synced.begin(), synced.end(), (scratch() / "mnt").native()), synced.end());

    // A source whose immutable parent keeps it from being removed is still moved.
    fs::create_directories(reference / "src/sub");
    writeFile(reference / "src/sub/f", "f");
    if (!setImmutable(reference, true))
        GTEST_SKIP() << "FS_IOC_SETFLAGS is not supported here";
    moved = fm()->moveItemAtURL(reference / "src", scratch() / "mnt/dst", &error);
    setImmutable(reference, false);
    ASSERT_TRUE(moved) << error->description();
    EXPECT_EQ(readFile(scratch() / "mnt/dst/sub/f"), "f");
    EXPECT_TRUE(fs::exists(reference / "src"));
}

TEST_F(CopyMove, DurableMoveSyncsContentsBeforeTheRenameAndDirectoriesAfter) {
    fs::path staging = scratch() / "staging";
    fs::path live = scratch() / "live";
    fs::create_directories(staging / "container/Library");
    fs::create_directories(live);
    writeFile(staging / "container/.metadata.plist", "m");
    writeFile(staging / "container/Library/prefs", "p");
    fs::path destination = live / "container";

    // Whether the destination was visible when each path was first synced.
    std::map<std::string, bool> synced;
    STWFileManager::setSyncObserverForTesting(
        [&](const std::string& path) { synced.emplace(path, fs::exists(destination)); });
    STWErrorRef error;
    bool moved = fm()->moveItemAtURL(staging / "container", destination, STWFileManagerMoveDurable, &error);
    ASSERT_TRUE(moved) << error->description();
    auto visibleWhenSynced = [&](const fs::path& path) -> std::optional<bool> {
        auto sync = synced.find(path.native());
        return sync == synced.end() ? std::nullopt : std::optional(sync->second);
    };
    // Everything moved reaches the disk while it is still invisible at the destination...
    for (const char* item :
         {"container/.metadata.plist", "container/Library/prefs", "container/Library", "container"})
        EXPECT_EQ(visibleWhenSynced(staging / item), false) << item;
    // ...and both directories whose entries the rename changed are synced after it.
    for (const fs::path& directory : {live, staging})
        EXPECT_EQ(visibleWhenSynced(directory), true) << directory;

    // A plain move pays for none of it.
    synced.clear();
    EXPECT_TRUE(fm()->moveItemAtURL(destination, staging / "back"));
    STWFileManager::setSyncObserverForTesting(nullptr);
    EXPECT_TRUE(synced.empty());
}

} // namespace

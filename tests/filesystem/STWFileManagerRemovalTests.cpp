#include "Daemon/FileSystem/STWDirectoryWalker.h"
#include "tests/filesystem/STWFileSystemTestSupport.h"

#include <cerrno>
#include <dirent.h>
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

namespace fs = std::filesystem;
using namespace stwtest;

namespace {

class Removal : public FileSystemTest {};

TEST_F(Removal, MissingPathSucceedsAndEmptyPathIsRefused) {
    EXPECT_TRUE(fm()->removeItemAtURL(scratch() / "nothing-here"));
    STWErrorRef error;
    EXPECT_FALSE(fm()->removeItemAtURL("", &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->isPOSIX(EFAULT));
    EXPECT_EQ(error->message(), "nil url passed to -removeItemAtURL:error:");
    EXPECT_EQ(error->functionName(), "removeItemAtURL");
}

TEST_F(Removal, ImmutableItemsAreUnflaggedAndRemoved) {
    fs::path tree = scratch() / "tree";
    fs::create_directories(tree / "a/b");
    writeFile(tree / "a/b/locked", "x");
    writeFile(tree / "a/plain", "y");
    writeFile(tree / "top-locked", "z");
    if (!setImmutable(tree / "a/b/locked", true) || !setImmutable(tree / "top-locked", true))
        GTEST_SKIP() << "FS_IOC_SETFLAGS is not supported here (file system or privileges)";
    ASSERT_NE(unlink((tree / "a/b/locked").c_str()), 0) << "the flag must really block removal";

    STWErrorRef error;
    EXPECT_TRUE(fm()->removeItemAtURL(tree, &error)) << (error ? error->description() : "");
    EXPECT_FALSE(fs::exists(fs::symlink_status(tree)));

    // A single immutable file given directly is handled the same way.
    writeFile(scratch() / "single", "s");
    ASSERT_TRUE(setImmutable(scratch() / "single", true));
    EXPECT_TRUE(fm()->removeItemAtURL(scratch() / "single"));
    EXPECT_FALSE(fs::exists(fs::symlink_status(scratch() / "single")));
}

TEST_F(Removal, UnreadableSubdirectoryFailsWithItsErrorButTheRestIsRemoved) {
    if (geteuid() != 0)
        GTEST_SKIP() << "needs root to drop to another user";
    fs::path tree = scratch() / "tree";
    fs::create_directories(tree / "locked");
    fs::create_directories(tree / "open/inner");
    writeFile(tree / "locked/kept", "k");
    writeFile(tree / "open/inner/f", "f");
    writeFile(tree / "z-file", "z");
    for (const auto& entry : fs::recursive_directory_iterator(tree))
        ASSERT_EQ(lchown(entry.path().c_str(), kNobody, kNobody), 0);
    ASSERT_EQ(lchown(tree.c_str(), kNobody, kNobody), 0);
    ASSERT_EQ(chmod((tree / "locked").c_str(), 0), 0);

    int result = runAs(kNobody, kNobody, [&] {
        STWErrorRef error;
        if (STWFileManager::defaultManager()->removeItemAtURL(tree, &error))
            return 1;
        return error && error->isPOSIX(EACCES) ? 0 : 2;
    });
    EXPECT_EQ(result, 0);
    // Everything but the unreadable directory (and so the root) went.
    EXPECT_TRUE(fs::exists(tree / "locked/kept"));
    EXPECT_FALSE(fs::exists(tree / "open"));
    EXPECT_FALSE(fs::exists(tree / "z-file"));
}

TEST_F(Removal, LinksOutOfTheTreeAreRemovedNeverFollowed) {
    fs::path outside = scratch() / "outside";
    fs::create_directories(outside / "deep");
    writeFile(outside / "deep/precious", "p");
    writeFile(outside / "file", "f");
    fs::path tree = scratch() / "tree";
    fs::create_directories(tree / "sub");
    fs::create_directory_symlink(outside, tree / "to-dir");
    fs::create_directory_symlink("../../outside/deep", tree / "sub/relative-to-dir");
    fs::create_symlink(outside / "file", tree / "sub/to-file");
    fs::create_directory_symlink(outside, scratch() / "top-link");

    EXPECT_TRUE(fm()->removeItemAtURL(tree));
    EXPECT_FALSE(fs::exists(fs::symlink_status(tree)));
    // The URL itself being a link removes the link only.
    EXPECT_TRUE(fm()->removeItemAtURL(scratch() / "top-link"));
    EXPECT_FALSE(fs::exists(fs::symlink_status(scratch() / "top-link")));
    EXPECT_EQ(readFile(outside / "deep/precious"), "p");
    EXPECT_EQ(readFile(outside / "file"), "f");
}

TEST_F(Removal, DeepTreeNeedsBoundedDescriptors) {
    // Deeper than the walker keeps open, with a descriptor limit far below the depth.
    fs::path tree = scratch() / "deep";
    fs::create_directory(tree);
    int fd = open(tree.c_str(), O_RDONLY | O_DIRECTORY);
    ASSERT_GE(fd, 0);
    for (int i = 0; i < 1000; ++i) {
        ASSERT_EQ(mkdirat(fd, "d", 0755), 0);
        int next = openat(fd, "d", O_RDONLY | O_DIRECTORY);
        ASSERT_GE(next, 0);
        close(fd);
        fd = next;
        if (i % 100 == 0)
            close(openat(fd, "file", O_CREAT | O_WRONLY, 0644));
    }
    close(fd);
    int result = runAs(geteuid(), getegid(), [&] {
        struct rlimit limit = {300, 300};
        if (setrlimit(RLIMIT_NOFILE, &limit) != 0)
            return 3;
        return STWFileManager::defaultManager()->removeItemAtURL(tree) ? 0 : 1;
    });
    EXPECT_EQ(result, 0);
    EXPECT_FALSE(fs::exists(fs::symlink_status(tree)));
}

// Moves a directory away while the walk is below it and has let go of its parent.
class MovingDelegate : public STWDirectoryWalker::Delegate {
public:
    fs::path from, to;
    int busy = 0;
    bool moved = false;
    bool visitEntry(int, const std::string& directoryPath, const STWDirectoryWalker::Entry& entry) override {
        if (!moved && directoryPath.ends_with("/a/b/c")) {
            moved = true;
            EXPECT_EQ(rename(from.c_str(), to.c_str()), 0);
        }
        return entry.type == DT_DIR;
    }
    void leaveDirectory(int, const std::string&, const std::string&, int) override {}
    void openFailed(int, const std::string&, const std::string&, int) override {}
    void readFailed(const std::string&, int e) override {
        if (e == EBUSY)
            ++busy;
    }
};

TEST_F(Removal, WalkStopsWhenTheTreeIsMovedUnderIt) {
    fs::path root = scratch() / "root";
    fs::create_directories(root / "a/b/c");
    fs::create_directories(root / "elsewhere");
    writeFile(root / "a/b/c/f", "f");
    MovingDelegate delegate;
    delegate.from = root / "a/b";
    delegate.to = root / "elsewhere/b";
    int fd = open(root.c_str(), O_RDONLY | O_DIRECTORY);
    ASSERT_GE(fd, 0);
    STWDirectoryWalker(2).walk(fd, root, delegate);
    close(fd);
    EXPECT_TRUE(delegate.moved);
    EXPECT_EQ(delegate.busy, 1);
}

} // namespace

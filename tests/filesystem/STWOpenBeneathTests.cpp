#include "tests/filesystem/STWFileSystemTestSupport.h"

#include <cerrno>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace fs = std::filesystem;
using namespace stwtest;

namespace {

// Both the openat2 path and the component walk kernels without it fall back to.
class OpenBeneath : public FileSystemTest, public ::testing::WithParamInterface<bool> {
protected:
    void SetUp() override {
        FileSystemTest::SetUp();
        container = scratch() / "container";
        fs::create_directories(container / "Library/Caches");
        fs::create_directories(scratch() / "outside");
        writeFile(container / "Library/prefs", "p");
        writeFile(scratch() / "outside/secret", "s");
        dirfd = open(container.c_str(), O_RDONLY | O_DIRECTORY);
        ASSERT_GE(dirfd, 0);
    }
    void TearDown() override {
        close(dirfd);
        FileSystemTest::TearDown();
    }
    bool walking() const { return GetParam(); }

    // The errno of opening `relative`, 0 on success.
    int openError(const fs::path& relative, int flags = O_RDONLY, unsigned options = STWOpenBeneathDefault) {
        STWErrorRef error;
        STWFileDescriptor fd = walking() ? fm()->_openBeneathByComponents(dirfd, relative, flags, 0644, &error)
                                         : fm()->openBeneath(dirfd, relative, flags, 0644, options, &error);
        if (fd)
            return 0;
        EXPECT_TRUE(error);
        return error ? static_cast<int>(error->code()) : -1;
    }

    fs::path container;
    int dirfd = -1;
};

TEST_P(OpenBeneath, OpensAndCreatesInside) {
    EXPECT_EQ(openError("Library/prefs"), 0);
    EXPECT_EQ(openError("./Library//Caches", O_RDONLY | O_DIRECTORY), 0);
    EXPECT_EQ(openError(""), 0);
    EXPECT_EQ(openError("Library/new", O_WRONLY | O_CREAT | O_EXCL), 0);
    struct stat st;
    ASSERT_EQ(stat((container / "Library/new").c_str(), &st), 0);
    mode_t mask = umask(0);
    umask(mask);
    EXPECT_EQ(st.st_mode & 0777, 0644u & ~mask) << "the mode is passed on";
    EXPECT_EQ(openError("Library/missing"), ENOENT);
}

TEST_P(OpenBeneath, NothingLeadsOutOfTheDirectory) {
    fs::create_directory_symlink(scratch() / "outside", container / "Library/absolute");
    fs::create_directory_symlink("../../outside", container / "Library/relative");
    fs::create_symlink("/proc/self/root/etc/passwd", container / "magic");

    EXPECT_EQ(openError("../outside/secret"), EXDEV);
    EXPECT_EQ(openError((scratch() / "outside/secret").native()), EXDEV);
    for (const char* path : {"Library/absolute/secret", "Library/relative/secret", "magic"}) {
        int e = openError(path);
        EXPECT_TRUE(e == EXDEV || e == ELOOP) << path << ": " << e;
    }
    // Creating through a link planted as the last component does not create outside.
    fs::create_symlink(scratch() / "outside/created", container / "plant");
    EXPECT_NE(openError("plant", O_WRONLY | O_CREAT), 0);
    EXPECT_FALSE(fs::exists(scratch() / "outside/created"));
}

TEST_P(OpenBeneath, LinksInsideFollowOnlyWhenAllowed) {
    fs::create_directory_symlink("Library", container / "alias");
    if (walking()) {
        EXPECT_EQ(openError("alias/prefs"), ELOOP) << "the component walk refuses every link";
        return;
    }
    EXPECT_EQ(openError("alias/prefs"), 0);
    EXPECT_EQ(openError("Library/Caches/../prefs"), 0) << "'..' that stays inside is fine";
    EXPECT_EQ(openError("alias/prefs", O_RDONLY, STWOpenBeneathNoSymlinks), ELOOP);
}

INSTANTIATE_TEST_SUITE_P(, OpenBeneath, ::testing::Values(false, true),
                         [](const auto& info) { return info.param ? "ComponentWalk" : "Openat2"; });


// A staged directory swapped for a link after it was made is sent back by the publishing
// rename, which fails; a second publication under the same name never replaces the first.
using PublishStaged = FileSystemTest;
TEST_F(PublishStaged, AnImpostorIsSentBackAndNothingIsReplaced) {
    fs::path s = scratch();
    for (const char* directory : {"staging", "live", "elsewhere"})
        fs::create_directories(s / directory);
    STWFileDescriptor staging = fm()->openDirectoryAtURL(s / "staging"), live = fm()->openDirectoryAtURL(s / "live");
    ASSERT_TRUE(staging && live);
    auto publish = [&](const std::string& name, int directoryfd, STWErrorRef* error) {
        return fm()->moveDirectoryAt(staging.get(), name, live.get(), "final", directoryfd, STWFileManagerMoveDurable,
                                     s / "staging" / name, s / "live/final", error);
    };
    STWFileDescriptor made = fm()->createNewDirectoryAt(staging.get(), "new", 0755, STWFileManagerOwnerUnchanged,
                                                        STWFileManagerClassUnchanged, s / "staging/new");
    ASSERT_TRUE(made);
    fs::rename(s / "staging/new", s / "staging/moved");
    fs::create_directory_symlink(s / "elsewhere", s / "staging/new");
    STWErrorRef error;
    EXPECT_FALSE(publish("new", made.get(), &error));
    EXPECT_TRUE(error && error->isPOSIX(ESTALE));
    EXPECT_TRUE(fs::is_empty(s / "live"));
    EXPECT_TRUE(fs::is_symlink(s / "staging/new"));

    fs::remove(s / "staging/new");
    fs::rename(s / "staging/moved", s / "staging/new");
    ASSERT_TRUE(publish("new", made.get(), nullptr));
    fs::create_directory(s / "staging/again");
    error.reset();
    EXPECT_FALSE(publish("again", fm()->openDirectoryAtURL(s / "staging/again").get(), &error));
    EXPECT_TRUE(error && error->isPOSIX(EEXIST));
}

// Only links no one but root could have placed are followed; a removal in place takes what
// the directory held when it was opened and leaves whatever took its name since.
using ForeignLinks = FileSystemTest;
TEST_F(ForeignLinks, OnlyRootsLinksAreFollowedAndRemovalKeepsToItsDirectory) {
    if (geteuid() != 0)
        GTEST_SKIP() << "needs root to give a directory to another user";
    fs::path s = scratch();
    fs::create_directories(s / "target/item");
    fs::create_directories(s / "user/item");
    fs::create_directories(s / "outside/victim");
    fs::create_directory_symlink(s / "target", s / "rootlink");
    fs::create_directory_symlink(s / "outside", s / "user/link");
    ASSERT_EQ(chown((s / "user").c_str(), 501, 501), 0);
    EXPECT_TRUE(fm()->moveItemAtURLWithoutForeignLinks(s / "rootlink/item", s / "moved", STWFileManagerMoveDefault));
    STWErrorRef error;
    EXPECT_FALSE(fm()->moveItemAtURLWithoutForeignLinks(s / "user/link/victim", s / "taken", STWFileManagerMoveDefault,
                                                        &error));
    EXPECT_TRUE(error && error->isPOSIX(ELOOP));
    EXPECT_TRUE(fs::is_directory(s / "outside/victim"));
    EXPECT_TRUE(fm()->moveItemAtURLWithoutForeignLinks(s / "user/item", s / "user/kept", STWFileManagerMoveDefault));

    writeFile(s / "user/kept/file", "f");
    STWFileDescriptor parent = fm()->openDirectoryAtURL(s / "user"), kept = fm()->openDirectoryAtURL(s / "user/kept");
    fs::rename(s / "user/kept", s / "user/away");
    fs::create_directory(s / "user/kept");
    writeFile(s / "user/kept/theirs", "t");
    error.reset();
    EXPECT_FALSE(fm()->removeDirectoryAt(parent.get(), "kept", kept.get(), s / "user/kept", &error));
    EXPECT_TRUE(error && error->isPOSIX(ESTALE));
    EXPECT_TRUE(fs::is_empty(s / "user/away"));
    EXPECT_TRUE(fs::exists(s / "user/kept/theirs"));
}

} // namespace

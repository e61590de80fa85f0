// Armed faults fail the nth call of their point with their errno and leave nothing half-made;
// a creation failed at each call of each point is in the end-to-end crash tests.
#include "Daemon/FileSystem/STWFaultInjection.h"
#include "tests/filesystem/STWFileSystemTestSupport.h"

#include <algorithm>
#include <cerrno>
#include <string>
#include <vector>

namespace fs = std::filesystem;
using namespace stwtest;

namespace {

class FaultInjection : public FileSystemTest {
protected:
    void TearDown() override {
        STWFaultInjection::disarm();
        FileSystemTest::TearDown();
    }
    static int code(const STWErrorRef& error) { return error ? static_cast<int>(error->code()) : 0; }
    static std::vector<std::string> names(const fs::path& directory) {
        std::vector<std::string> names;
        for (const auto& entry : fs::directory_iterator(directory))
            names.push_back(entry.path().filename());
        std::sort(names.begin(), names.end());
        return names;
    }
    STWFileDescriptor openDirectory(const fs::path& path) { return fm()->openDirectoryAtURL(path); }
};

// A metadata write: a temporary file written and synced, then renamed over the old file.
TEST_F(FaultInjection, FailedWriteOrReplaceKeepsTheOldFileAndNoTemporary) {
    writeFile(scratch() / "file", "old");
    STWFileDescriptor dirfd = openDirectory(scratch());
    EXPECT_FALSE(STWFaultInjection::arm("rename", 1, EIO)) << "an unknown point is refused";
    EXPECT_FALSE(STWFaultInjection::armFromList("renameat2:1")) << "a malformed list is refused";
    ASSERT_TRUE(STWFaultInjection::arm("fsync", 2, EIO));

    auto first = fm()->writeTemporaryFileAt(dirfd.get(), "new", 0644, scratch());
    ASSERT_TRUE(first) << "the first sync goes through";
    STWErrorRef error;
    EXPECT_FALSE(fm()->writeTemporaryFileAt(dirfd.get(), "other", 0644, scratch(), &error));
    EXPECT_EQ(code(error), EIO);
    EXPECT_EQ(names(scratch()), (std::vector<std::string>{first->name, "file"}));

    ASSERT_TRUE(STWFaultInjection::arm("renameat2", 1, ENOSPC));
    error = nullptr;
    EXPECT_FALSE(
        fm()->replaceFileAt(dirfd.get(), *first, "file", false, nullptr, scratch() / "file", &error));
    EXPECT_EQ(code(error), ENOSPC);
    EXPECT_EQ(names(scratch()), std::vector<std::string>{"file"});
    EXPECT_EQ(readFile(scratch() / "file"), "old");

    // Both faults are spent.
    auto again = fm()->writeTemporaryFileAt(dirfd.get(), "new", 0644, scratch());
    ASSERT_TRUE(again);
    EXPECT_TRUE(fm()->replaceFileAt(dirfd.get(), *again, "file", false, nullptr, scratch() / "file"));
    EXPECT_EQ(readFile(scratch() / "file"), "new");

    // Once renamed, the new file is the file: a failed sync of the directory after the rename
    // must not report the old one as still in place (the caller would keep its identity and
    // take the new file for a stranger's).
    auto last = fm()->writeTemporaryFileAt(dirfd.get(), "last", 0644, scratch());
    ASSERT_TRUE(last);
    ASSERT_TRUE(STWFaultInjection::arm("fsync", 1, EIO));
    struct stat identity{};
    EXPECT_TRUE(fm()->replaceFileAt(dirfd.get(), *last, "file", false, &identity, scratch() / "file"));
    struct stat onDisk{};
    ASSERT_EQ(stat((scratch() / "file").c_str(), &onDisk), 0);
    EXPECT_EQ(identity.st_ino, onDisk.st_ino);
    EXPECT_EQ(readFile(scratch() / "file"), "last");
}

} // namespace

// A directory moved whose parents then fail to sync goes back, and the move fails; when it
// cannot go back either, the move stands and answers success, so no caller takes a
// published directory for one that is not.
TEST_F(FaultInjection, AnUnsyncedMoveGoesBackOrStands) {
    fs::create_directories(scratch() / "from/item");
    fs::create_directories(scratch() / "to");
    STWFileDescriptor from = openDirectory(scratch() / "from"), to = openDirectory(scratch() / "to");
    STWFileDescriptor item = openDirectory(scratch() / "from/item");
    auto move = [&] {
        return fm()->moveDirectoryAt(from.get(), "item", to.get(), "item", item.get(),
                                     STWFileManagerMoveSyncDirectories, scratch() / "from/item", scratch() / "to/item");
    };
    ASSERT_TRUE(STWFaultInjection::arm("fsync", 1, EIO));
    EXPECT_FALSE(move());
    EXPECT_EQ(names(scratch() / "from"), std::vector<std::string>{"item"});
    ASSERT_TRUE(STWFaultInjection::armFromList("fsync:1:5,renameat2:2:28"));
    EXPECT_TRUE(move());
    EXPECT_EQ(names(scratch() / "to"), std::vector<std::string>{"item"});
}

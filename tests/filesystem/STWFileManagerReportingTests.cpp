// What the file layer tells its callers and the log: the POSIX errors that are passed on
// to clients unchanged, and the orphan listing the start-up cleanup records.
#include "common/STWFileIO.h"
#include "common/STWLog.h"
#include "platform/STWKeybag.h"
#include "tests/filesystem/STWFileSystemTestSupport.h"

#include <cerrno>
#include <cstring>
#include <functional>
#include <sys/stat.h>

namespace fs = std::filesystem;
using namespace stwtest;

namespace {

class Reporting : public FileSystemTest {
protected:
    void TearDown() override {
        STWKeybag::setLockStateOverrideForTesting(std::nullopt);
        FileSystemTest::TearDown();
    }
};

// The walk that stands in for openat2 reports its refusals and failed opens with their
// errno in the open-beneath tests.
TEST_F(Reporting, FailuresCarryTheirErrno) {
    std::string dir = scratch().native(), missing = dir + "/missing", file = dir + "/file";
    writeFile(file, "f");
    ASSERT_TRUE(fm()->setDataProtectionClassOfItemAtURL(file, 1, nullptr));
    int32_t value = 0;
    using Operation = std::function<bool(STWErrorRef*)>;
    const struct {
        Operation operation;
        int code;
        bool locked = false;
    } cases[] = {
        {[&](STWErrorRef* e) { return fm()->createDirectoryAtURL(missing + "/child", false, 0755, e); },
         ENOENT},
        {[&](STWErrorRef* e) { return fm()->copyItemAtURL(missing, dir + "/copy", e); }, ENOENT},
        {[&](STWErrorRef* e) { return fm()->moveItemAtURL(missing, dir + "/moved", e); }, ENOENT},
        {[&](STWErrorRef* e) { return bool(fm()->createTemporaryDirectoryInDirectoryURL(missing, "p.", e)); },
         ENOENT},
        {[&](STWErrorRef* e) { return bool(fm()->urlsForItemsInDirectoryAtURL(missing, e)); }, ENOENT},
        {[&](STWErrorRef* e) { return bool(fm()->itemsInDirectoryAtURL(missing, e)); }, ENOENT},
        {[&](STWErrorRef* e) { return fm()->dataProtectionClassOfItemAtURL(missing, &value, e); }, ENOENT},
        {[&](STWErrorRef* e) { return fm()->dataProtectionClassOfItemAtURL(file, &value, e); }, EPERM, true},
        {[&](STWErrorRef* e) { return fm()->setDataProtectionClassOfItemAtURL(file, 3, nullptr, e); }, EPERM,
         true},
        {[&](STWErrorRef* e) {
             return fm()->setDataProtectionClassOfItemAtURL(
                 file, 3, [](int32_t) { return true; }, e);
         },
         EPERM, true},
        {[&](STWErrorRef* e) { return fm()->createDirectoryAtURL(dir + "/protected", false, 0755, 0, 1, e); },
         EPERM, true},
    };
    for (size_t i = 0; i < std::size(cases); ++i) {
        STWKeybag::setLockStateOverrideForTesting(cases[i].locked);
        STWErrorRef error;
        EXPECT_FALSE(cases[i].operation(&error)) << i;
        ASSERT_TRUE(error) << i;
        EXPECT_TRUE(error->isPOSIX(cases[i].code)) << error->description();
    }
}

// The orphan cleanup records what it is about to remove: one line per item, directories
// once (not again on the way out), links never followed, and nothing changed.
TEST_F(Reporting, OrphanListingLogsEveryItemOnceAndChangesNothing) {
    fs::path tree = scratch() / "orphan";
    fs::create_directories(tree / "Library/Caches");
    fs::create_directories(scratch() / "outside/hidden");
    writeFile(tree / "Library/Caches/blob", "b");
    writeFile(tree / ".metadata", "m");
    fs::create_directory_symlink(scratch() / "outside", tree / "link");
    fs::create_symlink("nowhere", tree / "dangling");
    ASSERT_EQ(mkfifo((tree / "fifo").c_str(), 0600), 0);

    fs::path log = scratch() / "stowlyd.log";
    ASSERT_TRUE(STWLog::openLogFile(log, "com.vorlane.stowlyd", STWLogLevel::Default));
    STWLog::enableFileWriting(1, 1 << 20);
    fm()->printDirectoryStructureAtURL(tree);
    STWLog::flush();
    STWLog::closeLogFile();
    std::string text;
    ASSERT_EQ(STWReadFileContents(log, &text), 0);

    auto count = [&](const std::string& line) {
        size_t n = 0;
        for (size_t at = text.find(line); at != std::string::npos; at = text.find(line, at + 1))
            n += text.compare(at + line.size(), 1, "\n") == 0;
        return n;
    };
    for (const char* item : {"", "/Library", "/Library/Caches", "/Library/Caches/blob", "/.metadata", "/link",
                             "/dangling", "/fifo"})
        EXPECT_EQ(count("\tOrphaned File: " + tree.native() + item), 1u) << item << "\n" << text;
    EXPECT_EQ(text.find(scratch().native() + "/outside/hidden"), std::string::npos)
        << "the link was followed";

    EXPECT_TRUE(fs::is_fifo(tree / "fifo"));
    EXPECT_TRUE(fs::is_symlink(tree / "link"));
    EXPECT_EQ(readFile(tree / "Library/Caches/blob"), "b");
}

} // namespace

// What the file layer tells its callers and the log: the exact POSIX errors that are
// passed on to clients unchanged, and the orphan listing the start-up cleanup records.
#include "platform/STWKeybag.h"
#include "common/STWFileIO.h"
#include "common/STWLog.h"
#include "tests/filesystem/STWFileSystemTestSupport.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <functional>
#include <set>
#include <sys/stat.h>
#include <unistd.h>

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

TEST_F(Reporting, FailuresCarryTheirErrnoExactMessageOperationAndSite) {
    std::string dir = scratch().native(), missing = dir + "/missing", file = dir + "/file";
    std::string noent = strerror(ENOENT), eperm = strerror(EPERM);
    writeFile(file, "f");
    ASSERT_TRUE(fm()->setDataProtectionClassOfItemAtURL(file, 1, nullptr));
    int32_t value = 0;
    using Operation = std::function<bool(STWErrorRef*)>;
    struct Case {
        Operation operation;
        int code;
        std::string message;
        const char* function;
        bool locked = false;
    } cases[] = {
        {[&](STWErrorRef* e) { return fm()->createDirectoryAtURL(missing + "/child", false, 0755, e); }, ENOENT,
         "mkdir of " + missing + "/child failed: " + noent, "createDirectoryAtURL"},
        {[&](STWErrorRef* e) { return fm()->createDirectoryAtURL(file + "/child", true, 0755, e); }, ENOTDIR,
         "mkpath_np of " + file + "/child failed: " + strerror(ENOTDIR), "createDirectoryAtURL"},
        {[&](STWErrorRef* e) { return fm()->copyItemAtURL(missing, dir + "/copy", e); }, ENOENT,
         "copyfile of " + missing + " to " + dir + "/copy failed: " + noent, "_copyItemAtURL"},
        {[&](STWErrorRef* e) { return fm()->moveItemAtURL(missing, dir + "/moved", e); }, ENOENT,
         "rename of " + missing + " to " + dir + "/moved failed: " + noent, "_moveItemAtURL"},
        {[&](STWErrorRef* e) { return bool(fm()->createTemporaryDirectoryInDirectoryURL(missing, "p.", e)); },
         ENOENT, "Failed to create temp dir at path " + missing + "/p.XXXXXX : " + noent,
         "createTemporaryDirectoryInDirectoryURL"},
        {[&](STWErrorRef* e) { return bool(fm()->urlsForItemsInDirectoryAtURL(missing, e)); }, ENOENT,
         "_IterateDirectory for " + missing + " returned " + noent, "urlsForItemsInDirectoryAtURL"},
        {[&](STWErrorRef* e) { return fm()->_traverseDirectory(missing, e, [](FTSENT*, STWErrorRef*) { return true; }); },
         ENOENT, "Error for path " + missing + ": " + noent, "_traverseDirectory"},
        {[&](STWErrorRef* e) { return fm()->dataProtectionClassOfItemAtURL(missing, &value, e); }, ENOENT,
         "Failed to open " + missing + " : " + noent, "dataProtectionClassOfItemAtURL"},
        {[&](STWErrorRef* e) { return fm()->dataProtectionClassOfItemAtURL(file, &value, e); }, EPERM,
         "Failed to getclass of file " + file + ": " + eperm, "dataProtectionClassOfItemAtURL", true},
        {[&](STWErrorRef* e) { return fm()->setDataProtectionClassOfItemAtURL(file, 3, nullptr, e); }, EPERM,
         "Failed to setclass(3) on file " + file + ": " + eperm, "setDataProtectionClassOfItemAtURL", true},
        {[&](STWErrorRef* e) { return fm()->setDataProtectionClassOfItemAtURL(file, 3, [](int32_t) { return true; }, e); },
         EPERM, "Failed to getclass of file " + file + ": " + eperm, "setDataProtectionClassOfItemAtURL", true},
        {[&](STWErrorRef* e) { return fm()->createDirectoryAtURL(dir + "/protected", false, 0755, 0, 1, e); }, EPERM,
         "Failed to setclass(1) on directory " + dir + "/protected: " + eperm, "createDirectoryAtURL", true},
    };
    std::set<std::pair<std::string, uint64_t>> sites;
    for (const Case& c : cases) {
        STWKeybag::setLockStateOverrideForTesting(c.locked);
        STWErrorRef error;
        EXPECT_FALSE(c.operation(&error)) << c.message;
        ASSERT_TRUE(error) << c.message;
        EXPECT_TRUE(error->isPOSIX(c.code)) << error->description();
        EXPECT_EQ(error->message(), c.message);
        EXPECT_EQ(error->functionName(), c.function);
        EXPECT_GT(error->sourceFileLine(), 0u);
        sites.insert({error->functionName(), error->sourceFileLine()});
    }
    // Failures of one operation at different steps are different sites.
    EXPECT_EQ(std::count_if(sites.begin(), sites.end(), [](auto& site) { return site.first == "createDirectoryAtURL"; }),
              3)
        << "mkdir, mkpath_np and setclass fail at three sites";

    // The walk that stands in for openat2 names itself, not a helper, and tells its
    // refusals apart from its failed opens.
    STWFileDescriptor directory(open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    ASSERT_TRUE(directory);
    STWErrorRef refusal, failure;
    EXPECT_FALSE(fm()->_openBeneathByComponents(directory.get(), "../x", O_RDONLY, 0, &refusal));
    EXPECT_FALSE(fm()->_openBeneathByComponents(directory.get(), "missing/x", O_RDONLY, 0, &failure));
    ASSERT_TRUE(refusal && failure);
    EXPECT_TRUE(failure->isPOSIX(ENOENT));
    EXPECT_EQ(refusal->functionName(), "_openBeneathByComponents");
    EXPECT_EQ(failure->functionName(), "_openBeneathByComponents");
    EXPECT_NE(failure->sourceFileLine(), refusal->sourceFileLine());
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
    fm()->printDirectoryStructureAtURL(scratch() / "missing");
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
    EXPECT_EQ(text.find(scratch().native() + "/outside/hidden"), std::string::npos) << "the link was followed";
    EXPECT_EQ(count("FTS returned error for " + (scratch() / "missing").native() + " : " + strerror(ENOENT)), 1u)
        << text;

    EXPECT_TRUE(fs::is_fifo(tree / "fifo"));
    EXPECT_TRUE(fs::is_symlink(tree / "link"));
    EXPECT_EQ(readFile(tree / "Library/Caches/blob"), "b");
}

} // namespace

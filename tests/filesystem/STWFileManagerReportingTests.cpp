// What the file layer tells its callers and the log: the exact POSIX errors that are
// passed on to clients unchanged, and the orphan listing the start-up cleanup records.
#include "platform/STWKeybag.h"
#include "common/STWFileIO.h"
#include "common/STWLog.h"
#include "tests/filesystem/STWFileSystemTestSupport.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
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

    // Checks one failure: its domain and code, the exact message, the operation it names
    // and a failure site; remembers the site so that sites can be compared.
    void expectError(const STWErrorRef& error, int code, const std::string& message, const char* function) {
        ASSERT_TRUE(error) << message;
        EXPECT_TRUE(error->isPOSIX(code)) << error->description();
        EXPECT_EQ(error->message(), message);
        EXPECT_EQ(error->functionName(), function);
        EXPECT_GT(error->sourceFileLine(), 0u);
        sites.insert({error->functionName(), error->sourceFileLine()});
    }

    std::set<std::pair<std::string, uint64_t>> sites;
};

TEST_F(Reporting, FailuresCarryTheirErrnoExactMessageOperationAndSite) {
    std::string dir = scratch().native();
    std::string missing = dir + "/missing";
    std::string noent = strerror(ENOENT);
    writeFile(scratch() / "file", "f");
    STWErrorRef error;

    EXPECT_FALSE(fm()->createDirectoryAtURL(missing + "/child", false, 0755, &error));
    expectError(error, ENOENT, "mkdir of " + missing + "/child failed: " + noent, "createDirectoryAtURL");
    error.reset();
    EXPECT_FALSE(fm()->createDirectoryAtURL(dir + "/file/child", true, 0755, &error));
    expectError(error, ENOTDIR, "mkpath_np of " + dir + "/file/child failed: " + strerror(ENOTDIR),
                "createDirectoryAtURL");

    error.reset();
    EXPECT_FALSE(fm()->copyItemAtURL(missing, dir + "/copy", &error));
    expectError(error, ENOENT, "copyfile of " + missing + " to " + dir + "/copy failed: " + noent, "_copyItemAtURL");
    error.reset();
    EXPECT_FALSE(fm()->moveItemAtURL(missing, dir + "/moved", &error));
    expectError(error, ENOENT, "rename of " + missing + " to " + dir + "/moved failed: " + noent, "_moveItemAtURL");

    error.reset();
    EXPECT_FALSE(fm()->createTemporaryDirectoryInDirectoryURL(missing, "p.", &error));
    expectError(error, ENOENT, "Failed to create temp dir at path " + missing + "/p.XXXXXX : " + noent,
                "createTemporaryDirectoryInDirectoryURL");

    error.reset();
    EXPECT_FALSE(fm()->urlsForItemsInDirectoryAtURL(missing, &error));
    expectError(error, ENOENT, "_IterateDirectory for " + missing + " returned " + noent,
                "urlsForItemsInDirectoryAtURL");
    error.reset();
    EXPECT_FALSE(fm()->_traverseDirectory(missing, &error, [](FTSENT*, STWErrorRef*) { return true; }));
    expectError(error, ENOENT, "Error for path " + missing + ": " + noent, "_traverseDirectory");

    int32_t value = 0;
    error.reset();
    EXPECT_FALSE(fm()->dataProtectionClassOfItemAtURL(missing, &value, &error));
    expectError(error, ENOENT, "Failed to open " + missing + " : " + noent, "dataProtectionClassOfItemAtURL");
    ASSERT_TRUE(fm()->setDataProtectionClassOfItemAtURL(dir + "/file", 1, nullptr));
    STWKeybag::setLockStateOverrideForTesting(true);
    std::string eperm = strerror(EPERM);
    error.reset();
    EXPECT_FALSE(fm()->dataProtectionClassOfItemAtURL(dir + "/file", &value, &error));
    expectError(error, EPERM, "Failed to getclass of file " + dir + "/file: " + eperm,
                "dataProtectionClassOfItemAtURL");
    error.reset();
    EXPECT_FALSE(fm()->setDataProtectionClassOfItemAtURL(dir + "/file", 3, nullptr, &error));
    expectError(error, EPERM, "Failed to setclass(3) on file " + dir + "/file: " + eperm,
                "setDataProtectionClassOfItemAtURL");
    error.reset();
    EXPECT_FALSE(fm()->setDataProtectionClassOfItemAtURL(dir + "/file", 3, [](int32_t) { return true; }, &error));
    expectError(error, EPERM, "Failed to getclass of file " + dir + "/file: " + eperm,
                "setDataProtectionClassOfItemAtURL");
    error.reset();
    EXPECT_FALSE(fm()->createDirectoryAtURL(dir + "/protected", false, 0755, 0, 1, &error));
    expectError(error, EPERM, "Failed to setclass(1) on directory " + dir + "/protected: " + eperm,
                "createDirectoryAtURL");

    // The walk that stands in for openat2 names itself, not a helper, and tells its
    // refusals apart from its failed opens.
    STWFileDescriptor directory(open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    ASSERT_TRUE(directory);
    error.reset();
    EXPECT_FALSE(fm()->_openBeneathByComponents(directory.get(), "../x", O_RDONLY, 0, &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(error->functionName(), "_openBeneathByComponents");
    uint64_t refusal = error->sourceFileLine();
    error.reset();
    EXPECT_FALSE(fm()->_openBeneathByComponents(directory.get(), "missing/x", O_RDONLY, 0, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->isPOSIX(ENOENT));
    EXPECT_EQ(error->functionName(), "_openBeneathByComponents");
    EXPECT_NE(error->sourceFileLine(), refusal);

    // Failures of one operation at different steps are different sites.
    size_t createSites = 0;
    for (const auto& site : sites)
        createSites += site.first == "createDirectoryAtURL";
    EXPECT_EQ(createSites, 3u) << "mkdir, mkpath_np and setclass fail at three sites";
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

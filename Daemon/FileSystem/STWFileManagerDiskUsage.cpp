// Disk usage of a tree, as du counts it, for the container-size queries.
#include "Daemon/FileSystem/STWFileManager.h"

#include "Daemon/FileSystem/STWDirectoryWalker.h"
#include "Daemon/FileSystem/STWFileSystemPrimitives.h"
#include "common/STWLog.h"
#include "platform/STWPlatformConfiguration.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <set>
#include <sys/stat.h>
#include <utility>

namespace fs = std::filesystem;
using namespace STWFileSystemPrimitives;

namespace {

struct DirectoryStatistics {
    int64_t totalSize = 0;
    uint64_t descendants = 0;
};

enum class DirectoryStatisticsMode { FastOnly, ForcedWalk };

class UsageContext : public STWDirectoryWalker::Delegate {
public:
    dev_t device = 0;
    DirectoryStatistics statistics;

    bool visitEntry(int dirfd, const std::string&, const STWDirectoryWalker::Entry& entry) override {
        struct stat st;
        // Items removed while we walk simply no longer count.
        if (fstatat(dirfd, entry.name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0)
            return false;
        ++statistics.descendants;
        bool isDirectory = S_ISDIR(st.st_mode);
        // Hard links share their blocks: count them once, as du does.
        if (!isDirectory && st.st_nlink > 1 && !_seen.insert({st.st_dev, st.st_ino}).second)
            return false;
        statistics.totalSize += static_cast<int64_t>(st.st_blocks) * 512;
        return isDirectory && st.st_dev == device;
    }
    void leaveDirectory(int, const std::string&, const std::string&, int) override {}
    void openFailed(int, const std::string& directoryPath, const std::string& name, int e) override {
        STW_LOG_DEBUG(STWLogCategory::FS, "Not counting %s: %s", joinPath(directoryPath, name), strerror(e));
    }
    void readFailed(const std::string& path, int e) override {
        STW_LOG_DEBUG(STWLogCategory::FS, "Not counting all of %s: %s", path, strerror(e));
    }

private:
    std::set<std::pair<dev_t, ino_t>> _seen;
};

// The directory-statistics query. Linux file systems maintain no per-directory statistics,
// so the fast-only mode has nothing to answer with.
int directoryStatistics(const std::string& path, int directoryfd, DirectoryStatisticsMode mode,
                        DirectoryStatistics* statistics) {
    if (mode == DirectoryStatisticsMode::FastOnly)
        return ENOTSUP;
    // The walk reads from the descriptor's offset: a caller's descriptor is reopened as "."
    // rather than consumed.
    STWFileDescriptor fd(directoryfd >= 0 ? openat(directoryfd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC)
                                          : open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!fd)
        return errno;
    struct stat st;
    if (fstat(fd.get(), &st) != 0)
        return errno;
    UsageContext context;
    context.device = st.st_dev;
    context.statistics.totalSize = static_cast<int64_t>(st.st_blocks) * 512;
    STWDirectoryWalker().walk(fd.get(), path, context);
    *statistics = context.statistics;
    return 0;
}

// The maintain-directory-statistics control; see directoryStatistics().
int maintainDirectoryStatistics(const std::string&) { return ENOTSUP; }

} // namespace

uint64_t STWFileManager::fastDiskUsageForURL(const fs::path& url, int directoryfd) const {
    if (!STWPlatformConfiguration::sharedInstance()->isFeatureEnabled("fast_container_sizing"))
        return diskUsageForURL(url, directoryfd);
    std::string path = pathString(url);
    TraceInterval trace("CalculatingDiskUsage", path);
    DirectoryStatistics statistics;
    int e = directoryStatistics(path, directoryfd, DirectoryStatisticsMode::FastOnly, &statistics);
    if (e == ENOTSUP) {
        if (int m = maintainDirectoryStatistics(path)) {
            STW_LOG_ERROR(STWLogCategory::FS, "Failed to set maintain-dir-stats on %s: (err %d) %s", path, m,
                          strerror(m));
            trace.end(path, 0);
            return diskUsageForURL(url, directoryfd);
        }
        STW_LOG_NOTICE(STWLogCategory::FS, "Enabled fast directory sizing on [%s]", path);
        e = directoryStatistics(path, directoryfd, DirectoryStatisticsMode::FastOnly, &statistics);
    }
    if (e) {
        STW_LOG_ERROR(STWLogCategory::FS, "Failed to get dirstats on %s: (err %d) %s", path, e, strerror(e));
        trace.end(path, 0);
        return diskUsageForURL(url, directoryfd);
    }
    if (statistics.totalSize < 0) {
        STW_LOG_ERROR(STWLogCategory::FS, "Invalid size (%lld) from dirstats on %s: (err %d) %s",
                      statistics.totalSize, path, 0, strerror(0));
        trace.end(path, statistics.descendants);
        return diskUsageForURL(url, directoryfd);
    }
    uint64_t size = static_cast<uint64_t>(statistics.totalSize);
    STW_LOG_INFO(STWLogCategory::FS, "[%s]: descendants: %llu, total size: %llu", path, statistics.descendants,
                 size);
    trace.end(path, statistics.descendants, size);
    return size;
}

uint64_t STWFileManager::diskUsageForURL(const fs::path& url, int directoryfd) const {
    std::string path = pathString(url);
    TraceInterval trace("CalculatingDiskUsage", path);
    if (path.empty()) {
        STW_LOG_ERROR(STWLogCategory::FS, "Failed to get path to url %@", path);
        trace.end(path, 0);
        return 0;
    }
    DirectoryStatistics statistics;
    if (int e = directoryStatistics(path, directoryfd, DirectoryStatisticsMode::ForcedWalk, &statistics)) {
        STW_LOG_ERROR(STWLogCategory::FS, "Failed to get dirstats on %s using fallback: (err %d) %s", path, e,
                      strerror(e));
        trace.end(path, 0);
        return 0;
    }
    if (statistics.totalSize < 0) {
        STW_LOG_ERROR(STWLogCategory::FS, "Invalid size (%lld) from dirstats on %s using fallback: (err %d) %s",
                      statistics.totalSize, path, 0, strerror(0));
        trace.end(path, statistics.descendants);
        return 0;
    }
    uint64_t size = static_cast<uint64_t>(statistics.totalSize);
    STW_LOG_INFO(STWLogCategory::FS, "[%s]: descendants: %llu, total size: %llu, using fallback", path,
                 statistics.descendants, size);
    trace.end(path, statistics.descendants, size);
    return size;
}

// Listing, existence, tree traversal and printing of directories.
#include "Daemon/FileSystem/STWFileManager.h"

#include "Daemon/FileSystem/STWFileSystemPrimitives.h"
#include "common/STWLog.h"

#include <cerrno>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace fs = std::filesystem;
using namespace STWFileSystemPrimitives;

bool STWFileManager::_traverseDirectory(const fs::path& url, STWErrorRef* error,
                                        const TraversalVisitor& withBlock) const {
    std::string path = pathString(url);
    TraceInterval trace("TraversingDirectory", path);
    char* roots[] = {path.data(), nullptr};
    FTS* walk = fts_open(roots, FTS_PHYSICAL | FTS_NOCHDIR | FTS_XDEV, nullptr);
    if (!walk) {
        int e = errno;
        STWSetError(error, STW_POSIX_ERROR(e, "fts_open failed for %s with error %s", path, strerror(e)));
        trace.end(path, 0);
        return false;
    }
    bool ok = false;
    uint64_t nodes = 0;
    STWErrorRef walkError;
    for (bool first = true;; first = false) {
        errno = 0;
        FTSENT* entry = fts_read(walk);
        if (!entry) {
            int e = errno;
            if (e)
                walkError = STW_POSIX_ERROR(e, "Error for path %s: %s", path, strerror(e));
            // An empty first read is a failure without an error value.
            ok = !first && !e;
            break;
        }
        if (entry->fts_info == FTS_ERR || entry->fts_info == FTS_NS) {
            int e = entry->fts_errno;
            walkError = STW_POSIX_ERROR(e, "Error for path %s: %s", path, strerror(e));
            break;
        }
        ++nodes;
        STWErrorRef visitorError;
        if (!withBlock(entry, &visitorError)) {
            walkError = std::move(visitorError);
            break;
        }
    }
    if (fts_close(walk) != 0) {
        int e = errno;
        ok = false;
        if (!walkError)
            walkError = STW_POSIX_ERROR(e, "fts_close failed for %s with error %s", path, strerror(e));
    }
    trace.end(path, nodes);
    if (!ok)
        STWSetError(error, walkError);
    return ok;
}

std::optional<std::vector<fs::path>> STWFileManager::urlsForItemsInDirectoryAtURL(const fs::path& url,
                                                                                  STWErrorRef* error) const {
    std::string path = pathString(url);
    std::vector<fs::path> items;
    if (!_forEachItemInDirectory(path, __func__, error,
                                 [&](int, const dirent& entry) { items.emplace_back(joinPath(path, entry.d_name)); }))
        return std::nullopt;
    return items;
}

std::optional<std::vector<STWFileManager::DirectoryItem>> STWFileManager::itemsInDirectoryAtURL(const fs::path& url,
                                                                                              STWErrorRef* error) const {
    return itemsInDirectoryAt(-1, url, error);
}

std::optional<std::vector<STWFileManager::DirectoryItem>>
STWFileManager::itemsInDirectoryAt(int dirfd, const fs::path& url, STWErrorRef* error) const {
    std::string path = pathString(url);
    std::vector<DirectoryItem> items;
    bool listed = _forEachItemInDirectory(path, __func__, error, dirfd, [&](int directory, const dirent& entry) {
        bool isDirectory = entry.d_type == DT_DIR;
        struct stat st;
        if (entry.d_type == DT_UNKNOWN && fstatat(directory, entry.d_name, &st, AT_SYMLINK_NOFOLLOW) == 0)
            isDirectory = S_ISDIR(st.st_mode);
        items.push_back({entry.d_name, isDirectory});
    });
    if (!listed)
        return std::nullopt;
    return items;
}

bool STWFileManager::_forEachItemInDirectory(const std::string& path, const char* function, STWErrorRef* error,
                                             const std::function<void(int, const dirent&)>& body) const {
    return _forEachItemInDirectory(path, function, error, -1, body);
}

bool STWFileManager::_forEachItemInDirectory(const std::string& path, const char* function, STWErrorRef* error,
                                             int directoryfd, const std::function<void(int, const dirent&)>& body) const {
    // A descriptor of the caller's is read through a fresh open of "." in it, so that the
    // listing has a position of its own and closing it leaves the caller's descriptor open.
    DIR* directory = nullptr;
    if (directoryfd < 0) {
        directory = opendir(path.c_str());
    } else {
        int own = openat(directoryfd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
        directory = own < 0 ? nullptr : fdopendir(own);
        if (own >= 0 && !directory)
            close(own);
    }
    if (!directory) {
        int e = errno;
        if (e != ENOENT)
            STW_LOG_ERROR(STWLogCategory::FS, "opendir of %s failed: %s", path, strerror(e));
        STWSetError(error, STWErrorCreate(STWPOSIXErrorDomain, e, function, __LINE__, nullptr, false,
                                          "_IterateDirectory for %@ returned %s", path, strerror(e)));
        return false;
    }
    for (;;) {
        errno = 0;
        struct dirent* entry = readdir(directory);
        if (!entry) {
            int e = errno;
            closedir(directory);
            if (e) {
                STWSetError(error, STWErrorCreate(STWPOSIXErrorDomain, e, function, __LINE__, nullptr, true,
                                                  "_IterateDirectory for %@ returned %s", path, strerror(e)));
                return false;
            }
            return true;
        }
        if (entry->d_name[0] == '.')
            continue;
        try {
            body(dirfd(directory), *entry);
        } catch (...) {
            closedir(directory);
            throw;
        }
    }
}

bool STWFileManager::itemExistsAtURL(const fs::path& url) const {
    std::string path = pathString(url);
    struct stat st;
    if (lstat(path.c_str(), &st) == 0)
        return true;
    if (errno != ENOENT)
        STW_LOG_ERROR(STWLogCategory::FS, "Failed to determine if %@ exists: %s", path, strerror(errno));
    return false;
}

bool STWFileManager::itemDoesNotExistAtURL(const fs::path& url) const {
    std::string path = pathString(url);
    struct stat st;
    if (lstat(path.c_str(), &st) == 0)
        return false;
    if (errno == ENOENT)
        return true;
    STW_LOG_ERROR(STWLogCategory::FS, "Failed to determine if %@ exists: %s", path, strerror(errno));
    return false;
}

void STWFileManager::printDirectoryStructureAtURL(const fs::path& url) const {
    std::string path = pathString(url);
    char* roots[] = {path.data(), nullptr};
    FTS* walk = fts_open(roots, FTS_PHYSICAL | FTS_NOCHDIR | FTS_XDEV, nullptr);
    if (!walk) {
        STW_LOG_ERROR(STWLogCategory::FS, "fts_open failed for %@ : %s", path, strerror(errno));
        return;
    }
    while (FTSENT* entry = fts_read(walk)) {
        switch (entry->fts_info) {
        case FTS_D:
        case FTS_F:
        case FTS_SL:
        case FTS_SLNONE:
        case FTS_DEFAULT:
            STW_LOG_DEFAULT(STWLogCategory::FS, "\tOrphaned File: %s", entry->fts_path);
            break;
        case FTS_DP:
            break;
        default:
            STW_LOG_ERROR(STWLogCategory::FS, "FTS returned error for %s : %s", entry->fts_path,
                          strerror(entry->fts_errno));
            break;
        }
    }
    fts_close(walk);
}

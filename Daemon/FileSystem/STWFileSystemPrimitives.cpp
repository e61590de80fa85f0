// The system-call helpers that the sources of STWFileManager share: path pieces, durability,
// protection-class attributes, the user-immutable flag, and trace intervals.
#include "Daemon/FileSystem/STWFileSystemPrimitives.h"

#include "Daemon/FileSystem/STWDirectoryWalker.h"
#include "Daemon/FileSystem/STWFileManager.h"
#include "common/STWFileIO.h"
#include "common/STWLog.h"
#include "platform/STWKeybag.h"

#include <cerrno>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <functional>
#include <linux/fs.h>
#include <mutex>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <climits>
#include <unistd.h>

namespace fs = std::filesystem;

namespace STWFileSystemPrimitives {

constexpr const char* kProtectionClassAttribute = "trusted.stowly.protection-class";

std::string joinPath(const std::string& directory, const std::string& name) {
    if (directory.empty())
        return name;
    return directory.back() == '/' ? directory + name : directory + "/" + name;
}

// "/" followed by the non-empty components, as the real-path checks count them.
std::vector<std::string> pathComponents(std::string_view path) {
    std::vector<std::string> components;
    if (!path.empty() && path.front() == '/')
        components.emplace_back("/");
    size_t start = 0;
    while (start <= path.size()) {
        size_t end = path.find('/', start);
        if (end == std::string_view::npos)
            end = path.size();
        if (end > start)
            components.emplace_back(path.substr(start, end - start));
        start = end + 1;
    }
    return components;
}

bool hasPrefix(std::string_view text, std::string_view prefix) {
    return text.size() >= prefix.size() && text.compare(0, prefix.size(), prefix) == 0;
}

// The path as the daemon names it: no trailing separator (except for "/" itself).
std::string pathString(const fs::path& url) {
    std::string path = url.native();
    while (path.size() > 1 && path.back() == '/')
        path.pop_back();
    return path;
}

std::string parentPath(const fs::path& path) {
    fs::path parent = path.parent_path();
    return parent.empty() ? std::string(".") : parent.native();
}

std::string procfsPath(int fd) {
    return "/proc/self/fd/" + std::to_string(fd);
}

std::optional<std::filesystem::path> currentPathOfDescriptor(int fd) {
    char buffer[PATH_MAX];
    ssize_t n = readlink(procfsPath(fd).c_str(), buffer, sizeof buffer);
    if (n <= 0 || static_cast<size_t>(n) >= sizeof buffer || buffer[0] != '/')
        return std::nullopt;
    return std::filesystem::path(std::string(buffer, static_cast<size_t>(n)));
}

// MARK: durability

namespace {

std::mutex syncObserverMutex;
std::function<void(const std::string&)> syncObserver;

void noteSync(const std::string& path) {
    std::function<void(const std::string&)> observer;
    {
        std::lock_guard guard(syncObserverMutex);
        observer = syncObserver;
    }
    if (observer)
        observer(path);
}

// Fsyncs every regular file and directory of a tree, the directories after their contents.
class SyncTreeContext : public STWDirectoryWalker::Delegate {
public:
    int error = 0;

    bool visitEntry(int dirfd, const std::string& directoryPath, const STWDirectoryWalker::Entry& entry) override {
        unsigned char type = entry.type;
        if (type == DT_UNKNOWN) {
            struct stat st;
            if (fstatat(dirfd, entry.name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0)
                return _fail(errno), false;
            type = S_ISDIR(st.st_mode) ? DT_DIR : S_ISREG(st.st_mode) ? DT_REG : DT_UNKNOWN;
        }
        if (type == DT_DIR)
            return true;
        if (type == DT_REG) {
            STWFileDescriptor fd(openat(dirfd, entry.name.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NOCTTY));
            if (!fd)
                return _fail(errno), false;
            _fail(syncDescriptor(fd.get(), joinPath(directoryPath, entry.name)));
        }
        // Links and special files live in their directory's metadata, which is synced below.
        return false;
    }
    void leaveDirectory(int, const std::string& directoryPath, const std::string& name, int fd) override {
        _fail(syncDescriptor(fd, joinPath(directoryPath, name)));
    }
    void openFailed(int, const std::string&, const std::string&, int e) override { _fail(e); }
    void readFailed(const std::string&, int e) override { _fail(e); }
    bool shouldStop() const override { return error != 0; }

private:
    void _fail(int e) {
        if (e && !error)
            error = e;
    }
};

} // namespace

int syncDescriptor(int fd, const std::string& path) {
    if (int e = STWFaultInjection::check(STWFaultPoint::Sync))
        return e;
    noteSync(path);
    return fsync(fd) == 0 ? 0 : errno;
}

int syncDirectoryAtPath(const std::string& path) {
    if (int e = STWFaultInjection::check(STWFaultPoint::Sync))
        return e;
    noteSync(path);
    return STWSyncDirectory(path);
}

int syncTreeAt(int fd, const std::string& path) {
    struct stat st;
    if (fstat(fd, &st) != 0)
        return errno;
    if (S_ISDIR(st.st_mode)) {
        SyncTreeContext context;
        STWDirectoryWalker().walk(fd, path, context);
        if (context.error)
            return context.error;
    }
    return syncDescriptor(fd, path);
}

int syncTree(const std::string& path) {
    struct stat st;
    if (lstat(path.c_str(), &st) != 0)
        return errno;
    if (S_ISLNK(st.st_mode))
        return 0;
    int flags = O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NOCTTY | O_NONBLOCK | (S_ISDIR(st.st_mode) ? O_DIRECTORY : 0);
    STWFileDescriptor fd(open(path.c_str(), flags));
    if (!fd)
        return errno;
    return syncTreeAt(fd.get(), path);
}

// MARK: protection classes

int readProtectionClass(int fd, int32_t* dataProtectionClass) {
    unsigned char bytes[4];
    ssize_t n = fgetxattr(fd, kProtectionClassAttribute, bytes, sizeof bytes);
    int32_t value = 0;
    if (n < 0) {
        if (errno == ERANGE)
            return EINVAL; // not a 32-bit class: someone else wrote it
        if (errno != ENODATA)
            return errno;
    } else if (n != sizeof bytes) {
        return EINVAL;
    } else {
        value = static_cast<int32_t>(static_cast<uint32_t>(bytes[0]) | static_cast<uint32_t>(bytes[1]) << 8 |
                                     static_cast<uint32_t>(bytes[2]) << 16 | static_cast<uint32_t>(bytes[3]) << 24);
    }
    // Class 1 items are out of reach while the device is locked.
    if (value == 1 && STWKeybag::isDeviceLocked())
        return EPERM;
    *dataProtectionClass = value;
    return 0;
}

int writeProtectionClass(int fd, int32_t dataProtectionClass) {
    if (STWKeybag::isDeviceLocked()) {
        if (dataProtectionClass == 1)
            return EPERM;
        int32_t current = 0;
        if (int e = readProtectionClass(fd, &current))
            return e;
    }
    uint32_t value = static_cast<uint32_t>(dataProtectionClass);
    unsigned char bytes[4] = {static_cast<unsigned char>(value), static_cast<unsigned char>(value >> 8),
                              static_cast<unsigned char>(value >> 16), static_cast<unsigned char>(value >> 24)};
    return disk::fsetxattr(fd, kProtectionClassAttribute, bytes, sizeof bytes, 0) == 0 ? 0 : errno;
}

int setUserImmutable(int fd, bool immutable) {
    int flags = 0;
    if (ioctl(fd, FS_IOC_GETFLAGS, &flags) != 0)
        return errno;
    int wanted = immutable ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
    if (wanted == flags)
        return 0;
    if (int e = STWFaultInjection::check(STWFaultPoint::SetFlags))
        return e;
    return ioctl(fd, FS_IOC_SETFLAGS, &wanted) == 0 ? 0 : errno;
}

bool isUserImmutable(int fd) {
    int flags = 0;
    return ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0 && (flags & FS_IMMUTABLE_FL);
}

bool flagsUnsupported(int e) { return e == ENOTTY || e == ENOTSUP || e == EOPNOTSUPP || e == EINVAL; }

// The owner (as user and group) and class of a directory open as `fd`, each unless
// unchanged; errors name `path` and the public operation `function`.
bool setOwnerAndClassOfDirectory(int fd, uid_t owner, int32_t dataProtectionClass, const std::string& path,
                                 const char* function, STWErrorRef* error) {
    int e = 0;
    if (dataProtectionClass != STWFileManagerClassUnchanged && (e = writeProtectionClass(fd, dataProtectionClass))) {
        STWSetError(error, STWErrorCreate(STWPOSIXErrorDomain, e, function, __LINE__, nullptr, true,
                                          "Failed to setclass(%d) on directory %s: %s", dataProtectionClass, path,
                                          strerror(e)));
        return false;
    }
    if (owner != STWFileManagerOwnerUnchanged && disk::fchown(fd, owner, owner) != 0) {
        e = errno;
        STWSetError(error, STWErrorCreate(STWPOSIXErrorDomain, e, function, __LINE__, nullptr, true,
                                          "Failed to chown(%d,%d) %s: %s", owner, owner, path, strerror(e)));
        return false;
    }
    return true;
}


// MARK: trace intervals

TraceInterval::TraceInterval(const char* name, const std::string& path) : _name(name) {
    STW_LOG_DEBUG(STWLogCategory::FS, "%s begin: %s", name, path);
}

void TraceInterval::end(const std::string& path, uint64_t nodes, std::optional<uint64_t> size) {
    if (size)
        STW_LOG_DEBUG(STWLogCategory::FS, "%s end: %s nodes: %llu size: %llu", _name, path, nodes, *size);
    else
        STW_LOG_DEBUG(STWLogCategory::FS, "%s end: %s nodes: %llu", _name, path, nodes);
}

} // namespace STWFileSystemPrimitives

void STWFileManager::setSyncObserverForTesting(std::function<void(const std::string& path)> observer) {
    std::lock_guard guard(STWFileSystemPrimitives::syncObserverMutex);
    STWFileSystemPrimitives::syncObserver = std::move(observer);
}

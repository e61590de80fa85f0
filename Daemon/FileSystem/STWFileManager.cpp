#include "Daemon/FileSystem/STWFileManager.h"

#include "Daemon/FileSystem/STWDirectoryWalker.h"
#include "Daemon/FileSystem/STWFileSystemPrimitives.h"
#include "platform/STWKeybag.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWFileIO.h"
#include "common/STWLog.h"
#include "platform/STWPlatformConfiguration.h"
#include "platform/STWUserDatabase.h"

#include <acl/libacl.h>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <linux/fs.h>
#include <linux/openat2.h>
#include <mutex>
#include <set>
#include <sys/acl.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/xattr.h>
#include <unistd.h>
#include <utility>

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

// MARK: durability

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

int syncDescriptor(int fd, const std::string& path) {
    noteSync(path);
    return fsync(fd) == 0 ? 0 : errno;
}

int syncDirectoryAtPath(const std::string& path) {
    noteSync(path);
    return STWSyncDirectory(path);
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
    return fsetxattr(fd, kProtectionClassAttribute, bytes, sizeof bytes, 0) == 0 ? 0 : errno;
}

int setUserImmutable(int fd, bool immutable) {
    int flags = 0;
    if (ioctl(fd, FS_IOC_GETFLAGS, &flags) != 0)
        return errno;
    int wanted = immutable ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
    if (wanted == flags)
        return 0;
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
    if (owner != STWFileManagerOwnerUnchanged && fchown(fd, owner, owner) != 0) {
        e = errno;
        STWSetError(error, STWErrorCreate(STWPOSIXErrorDomain, e, function, __LINE__, nullptr, true,
                                          "Failed to chown(%d,%d) %s: %s", owner, owner, path, strerror(e)));
        return false;
    }
    return true;
}

} // namespace STWFileSystemPrimitives

using namespace STWFileSystemPrimitives;

namespace {

constexpr const char* kAccessACLAttribute = "system.posix_acl_access";
constexpr const char* kDefaultACLAttribute = "system.posix_acl_default";

// The path as the daemon names it: no trailing separator (except for "/" itself).
std::string pathString(const fs::path& url) {
    std::string path = url.native();
    while (path.size() > 1 && path.back() == '/')
        path.pop_back();
    return path;
}

std::string parentPath(const std::string& path) {
    fs::path parent = fs::path(path).parent_path();
    return parent.empty() ? std::string(".") : parent.native();
}

std::string joinComponents(const std::vector<std::string>& components, size_t begin, size_t end) {
    std::string path;
    for (size_t i = begin; i < end; ++i) {
        if (components[i] == "/")
            path = "/";
        else
            path = path.empty() || path.back() == '/' ? path + components[i] : path + "/" + components[i];
    }
    return path;
}

// Begins a trace interval: a debug line at each end (the toolchain has no USDT probes).
class TraceInterval {
public:
    TraceInterval(const char* name, const std::string& path) : _name(name) {
        STW_LOG_DEBUG(STWLogCategory::FS, "%s begin: %s", name, path);
    }
    void end(const std::string& path, uint64_t nodes, std::optional<uint64_t> size = std::nullopt) {
        if (size)
            STW_LOG_DEBUG(STWLogCategory::FS, "%s end: %s nodes: %llu size: %llu", _name, path, nodes, *size);
        else
            STW_LOG_DEBUG(STWLogCategory::FS, "%s end: %s nodes: %llu", _name, path, nodes);
    }

private:
    const char* _name;
};

// MARK: removal

// The per-item error handling of a tree removal: the first errno met is kept, and a
// user-immutable item is unflagged and unlinked instead of failing the removal.
class RemovalContext : public STWDirectoryWalker::Delegate {
public:
    int recordedError = 0;

    void itemFailed(int dirfd, const std::string& directoryPath, const std::string& name, int e) {
        std::string path = joinPath(directoryPath, name);
        if (e != ENOENT)
            STW_LOG_ERROR(STWLogCategory::FS, "removefile hit error for %s : %s", path, strerror(e));
        if (e == EPERM && _removeImmutableItem(dirfd, name, path))
            return;
        if (recordedError == 0)
            recordedError = e;
    }

    bool visitEntry(int dirfd, const std::string& directoryPath, const STWDirectoryWalker::Entry& entry) override {
        if (entry.type == DT_DIR)
            return true;
        // The entry type spares a stat: unlinking a directory answers EISDIR.
        if (unlinkat(dirfd, entry.name.c_str(), 0) == 0)
            return false;
        int e = errno;
        if (e == EISDIR)
            return true;
        itemFailed(dirfd, directoryPath, entry.name, e);
        return false;
    }
    void openFailed(int dirfd, const std::string& directoryPath, const std::string& name, int e) override {
        if (e == ENOTDIR || e == ELOOP) {
            // Replaced by a link or a file since it was listed: remove that instead.
            if (unlinkat(dirfd, name.c_str(), 0) == 0)
                return;
            e = errno;
        } else if (e != ENOENT && unlinkat(dirfd, name.c_str(), AT_REMOVEDIR) == 0) {
            return; // an empty directory we may not read can still go
        }
        itemFailed(dirfd, directoryPath, name, e);
    }
    void leaveDirectory(int dirfd, const std::string& directoryPath, const std::string& name, int) override {
        if (unlinkat(dirfd, name.c_str(), AT_REMOVEDIR) != 0)
            itemFailed(dirfd, directoryPath, name, errno);
    }
    void readFailed(const std::string& path, int e) override { itemFailed(AT_FDCWD, "", path, e); }

private:
    bool _removeImmutableItem(int dirfd, const std::string& name, const std::string& path) {
        struct stat st;
        if (fstatat(dirfd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) {
            STW_LOG_ERROR(STWLogCategory::FS, "Failed to stat %s before unsetting UF_IMMUTABLE: %s", path,
                          strerror(errno));
            return false;
        }
        // Inode flags are reached through a descriptor; only files and directories can be
        // opened for that without following a link or touching a device.
        if (!S_ISREG(st.st_mode) && !S_ISDIR(st.st_mode))
            return false;
        STWFileDescriptor fd(
            openat(dirfd, name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
        struct stat opened;
        if (!fd || fstat(fd.get(), &opened) != 0 || opened.st_ino != st.st_ino || opened.st_dev != st.st_dev)
            return false;
        if (!isUserImmutable(fd.get()))
            return false;
        if (int e = setUserImmutable(fd.get(), false)) {
            STW_LOG_ERROR(STWLogCategory::FS, "Failed to lchflags %s: %s", path, strerror(e));
            return false;
        }
        fd.reset();
        STW_LOG_NOTICE(STWLogCategory::FS, "Unset UF_IMMUTABLE on %s", path);
        if (unlinkat(dirfd, name.c_str(), S_ISDIR(st.st_mode) ? AT_REMOVEDIR : 0) != 0) {
            STW_LOG_ERROR(STWLogCategory::FS, "unlink of %s failed: %s", path, strerror(errno));
            return false;
        }
        return true;
    }
};

// The recursive-remove routine: answers its own failure (the root cannot be examined);
// failures of single items go to the context.
int removeTree(const std::string& path, RemovalContext& context) {
    struct stat st;
    if (lstat(path.c_str(), &st) != 0)
        return errno;
    if (!S_ISDIR(st.st_mode)) {
        if (unlink(path.c_str()) != 0)
            context.itemFailed(AT_FDCWD, "", path, errno);
        return 0;
    }
    STWFileDescriptor fd(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!fd) {
        context.openFailed(AT_FDCWD, "", path, errno);
        return 0;
    }
    STWDirectoryWalker().walk(fd.get(), path, context);
    fd.reset();
    if (rmdir(path.c_str()) != 0)
        context.itemFailed(AT_FDCWD, "", path, errno);
    return 0;
}

// MARK: copy

bool ignorableAttributeError(int e) { return e == ENOTSUP || e == EOPNOTSUPP; }

// Copies the extended attributes other than the ACLs, through descriptors or, for links
// and special files (which cannot be opened safely), through their paths without
// following them.
int copyExtendedAttributes(int sourceFd, int destinationFd, const std::string& sourcePath,
                           const std::string& destinationPath) {
    bool byPath = sourceFd < 0;
    auto list = [&](char* buffer, size_t size) {
        return byPath ? llistxattr(sourcePath.c_str(), buffer, size) : flistxattr(sourceFd, buffer, size);
    };
    auto get = [&](const char* name, void* buffer, size_t size) {
        return byPath ? lgetxattr(sourcePath.c_str(), name, buffer, size) : fgetxattr(sourceFd, name, buffer, size);
    };
    auto set = [&](const char* name, const void* value, size_t size) {
        return byPath ? lsetxattr(destinationPath.c_str(), name, value, size, 0)
                      : fsetxattr(destinationFd, name, value, size, 0);
    };
    std::vector<char> names;
    for (;;) {
        ssize_t size = list(nullptr, 0);
        if (size < 0)
            return ignorableAttributeError(errno) ? 0 : errno;
        if (size == 0)
            return 0;
        names.resize(static_cast<size_t>(size));
        size = list(names.data(), names.size());
        if (size >= 0) {
            names.resize(static_cast<size_t>(size));
            break;
        }
        if (errno != ERANGE) // ERANGE: the list grew meanwhile; ask again
            return errno;
    }
    std::vector<char> value;
    for (size_t offset = 0; offset < names.size();) {
        const char* name = names.data() + offset;
        offset += strlen(name) + 1;
        if (strcmp(name, kAccessACLAttribute) == 0 || strcmp(name, kDefaultACLAttribute) == 0)
            continue;
        ssize_t size;
        for (;;) {
            size = get(name, nullptr, 0);
            if (size < 0)
                break;
            value.resize(static_cast<size_t>(size));
            size = get(name, value.data(), value.size());
            if (size >= 0 || errno != ERANGE)
                break;
        }
        if (size < 0) {
            if (errno == ENODATA) // removed since it was listed
                continue;
            return errno;
        }
        if (set(name, value.data(), static_cast<size_t>(size)) != 0 && !ignorableAttributeError(errno))
            return errno;
    }
    return 0;
}

int copyACLs(int sourceFd, int destinationFd, bool isDirectory) {
    int extended = acl_extended_fd(sourceFd);
    if (extended < 0)
        return ignorableAttributeError(errno) ? 0 : errno;
    if (extended == 1) {
        acl_t acl = acl_get_fd(sourceFd);
        if (!acl)
            return errno;
        int e = acl_set_fd(destinationFd, acl) == 0 ? 0 : errno;
        acl_free(acl);
        if (e && !ignorableAttributeError(e))
            return e;
    }
    if (!isDirectory)
        return 0;
    // libacl reads default ACLs only by path; the attribute itself is reachable by
    // descriptor and carries the same entries.
    std::vector<char> value(256);
    ssize_t size;
    for (;;) {
        size = fgetxattr(sourceFd, kDefaultACLAttribute, value.data(), value.size());
        if (size >= 0 || errno != ERANGE)
            break;
        value.resize(value.size() * 4);
    }
    if (size < 0)
        return errno == ENODATA || ignorableAttributeError(errno) ? 0 : errno;
    if (fsetxattr(destinationFd, kDefaultACLAttribute, value.data(), static_cast<size_t>(size), 0) != 0 &&
        !ignorableAttributeError(errno))
        return errno;
    return 0;
}

int copyOwner(int e) {
    // Without privileges a copy keeps the copier's ownership, as cp does.
    return e == EPERM && geteuid() != 0 ? 0 : e;
}

// Ownership before mode (chown clears set-id bits), attributes after chown (it clears file
// capabilities), ACLs last (on Linux their mask is the group bits of the mode).
int copyMetadata(int sourceFd, int destinationFd, const struct stat& st, bool isDirectory) {
    if (fchown(destinationFd, st.st_uid, st.st_gid) != 0)
        if (int e = copyOwner(errno))
            return e;
    if (fchmod(destinationFd, st.st_mode & 07777) != 0)
        return errno;
    if (int e = copyExtendedAttributes(sourceFd, destinationFd, {}, {}))
        return e;
    return copyACLs(sourceFd, destinationFd, isDirectory);
}

int copyData(int sourceFd, int destinationFd) {
    if (ioctl(destinationFd, FICLONE, sourceFd) == 0)
        return 0;
    bool copiedAny = false;
    for (;;) {
        ssize_t n = copy_file_range(sourceFd, nullptr, destinationFd, nullptr, 1u << 30, 0);
        if (n > 0) {
            copiedAny = true;
            continue;
        }
        if (n == 0)
            return 0;
        if (errno == EINTR)
            continue;
        if (copiedAny || (errno != EXDEV && errno != EINVAL && errno != ENOSYS && errno != EOPNOTSUPP))
            return errno;
        break; // not between these two files: copy by hand
    }
    std::vector<char> buffer(128 * 1024);
    for (;;) {
        ssize_t n = read(sourceFd, buffer.data(), buffer.size());
        if (n < 0) {
            if (errno == EINTR)
                continue;
            return errno;
        }
        if (n == 0)
            return 0;
        for (ssize_t written = 0; written < n;) {
            ssize_t w = write(destinationFd, buffer.data() + written, static_cast<size_t>(n - written));
            if (w < 0) {
                if (errno == EINTR)
                    continue;
                return errno;
            }
            written += w;
        }
    }
}

int copyRegularFile(int sourceDirfd, const std::string& sourceName, int destinationDirfd,
                    const std::string& destinationName) {
    STWFileDescriptor in(openat(sourceDirfd, sourceName.c_str(), O_RDONLY | O_NOFOLLOW | O_NOCTTY | O_CLOEXEC));
    if (!in)
        return errno;
    struct stat st;
    if (fstat(in.get(), &st) != 0)
        return errno;
    if (!S_ISREG(st.st_mode))
        return EAGAIN; // replaced since it was examined
    STWFileDescriptor out(openat(destinationDirfd, destinationName.c_str(),
                                 O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_NOCTTY | O_CLOEXEC, 0600));
    if (!out)
        return errno;
    if (int e = copyData(in.get(), out.get()))
        return e;
    return copyMetadata(in.get(), out.get(), st, false);
}

int copyLink(int sourceDirfd, const std::string& sourceDirectory, const std::string& sourceName,
             const struct stat& st, int destinationDirfd, const std::string& destinationDirectory,
             const std::string& destinationName) {
    std::string target(static_cast<size_t>(st.st_size > 0 ? st.st_size : 255) + 1, '\0');
    for (;;) {
        ssize_t n = readlinkat(sourceDirfd, sourceName.c_str(), target.data(), target.size());
        if (n < 0)
            return errno;
        if (static_cast<size_t>(n) < target.size()) {
            target.resize(static_cast<size_t>(n));
            break;
        }
        target.resize(target.size() * 2);
    }
    if (symlinkat(target.c_str(), destinationDirfd, destinationName.c_str()) != 0) {
        if (errno != EEXIST)
            return errno;
        struct stat existing;
        if (fstatat(destinationDirfd, destinationName.c_str(), &existing, AT_SYMLINK_NOFOLLOW) == 0 &&
            S_ISDIR(existing.st_mode))
            return EEXIST;
        if (unlinkat(destinationDirfd, destinationName.c_str(), 0) != 0 ||
            symlinkat(target.c_str(), destinationDirfd, destinationName.c_str()) != 0)
            return errno;
    }
    if (fchownat(destinationDirfd, destinationName.c_str(), st.st_uid, st.st_gid, AT_SYMLINK_NOFOLLOW) != 0)
        if (int e = copyOwner(errno))
            return e;
    return copyExtendedAttributes(-1, -1, joinPath(sourceDirectory, sourceName),
                                  joinPath(destinationDirectory, destinationName));
}

int copySpecialFile(const std::string& sourceDirectory, const std::string& sourceName, const struct stat& st,
                    int destinationDirfd, const std::string& destinationDirectory,
                    const std::string& destinationName) {
    if (mknodat(destinationDirfd, destinationName.c_str(), st.st_mode & (S_IFMT | 0600), st.st_rdev) != 0)
        return errno;
    if (fchownat(destinationDirfd, destinationName.c_str(), st.st_uid, st.st_gid, AT_SYMLINK_NOFOLLOW) != 0)
        if (int e = copyOwner(errno))
            return e;
    // AT_SYMLINK_NOFOLLOW: a link swapped in for the new node must not have its target chmodded.
    if (fchmodat(destinationDirfd, destinationName.c_str(), st.st_mode & 07777, AT_SYMLINK_NOFOLLOW) != 0)
        return errno;
    return copyExtendedAttributes(-1, -1, joinPath(sourceDirectory, sourceName),
                                  joinPath(destinationDirectory, destinationName));
}

// Copies one item that is not a directory, or makes the directory that its contents go
// into (its metadata follows once they are copied).
int copyItem(int sourceDirfd, const std::string& sourceDirectory, const std::string& name, const struct stat& st,
             int destinationDirfd, const std::string& destinationDirectory, const std::string& destinationName) {
    switch (st.st_mode & S_IFMT) {
    case S_IFREG:
        return copyRegularFile(sourceDirfd, name, destinationDirfd, destinationName);
    case S_IFLNK:
        return copyLink(sourceDirfd, sourceDirectory, name, st, destinationDirfd, destinationDirectory,
                        destinationName);
    case S_IFDIR:
        // Private until its contents and metadata are in place.
        if (mkdirat(destinationDirfd, destinationName.c_str(), 0700) != 0 && errno != EEXIST)
            return errno;
        return 0;
    default:
        return copySpecialFile(sourceDirectory, name, st, destinationDirfd, destinationDirectory, destinationName);
    }
}

class CopyContext : public STWDirectoryWalker::Delegate {
public:
    struct Destination {
        int fd;
        std::string path;
    };
    // The destination of each directory being copied; the root's first.
    std::vector<Destination> destinations;
    int error = 0;
    std::string failedPath;

    ~CopyContext() override {
        for (const Destination& destination : destinations)
            close(destination.fd);
    }

    bool visitEntry(int dirfd, const std::string& directoryPath, const STWDirectoryWalker::Entry& entry) override {
        if (error)
            return false;
        struct stat st;
        if (fstatat(dirfd, entry.name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0)
            return _fail(errno, joinPath(directoryPath, entry.name)), false;
        const Destination& destination = destinations.back();
        if (int e = copyItem(dirfd, directoryPath, entry.name, st, destination.fd, destination.path, entry.name))
            return _fail(e, joinPath(directoryPath, entry.name)), false;
        return S_ISDIR(st.st_mode);
    }
    bool enterDirectory(int, const std::string& directoryPath, const std::string& name, int) override {
        if (error)
            return false;
        const Destination& parent = destinations.back();
        int fd = openat(parent.fd, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
        if (fd < 0)
            return _fail(errno, joinPath(parent.path, name)), false;
        destinations.push_back(Destination{fd, joinPath(parent.path, name)});
        (void)directoryPath;
        return true;
    }
    void leaveDirectory(int, const std::string& directoryPath, const std::string& name, int fd) override {
        Destination destination = std::move(destinations.back());
        destinations.pop_back();
        struct stat st;
        if (!error) {
            if (fstat(fd, &st) != 0)
                _fail(errno, joinPath(directoryPath, name));
            else if (int e = copyMetadata(fd, destination.fd, st, true))
                _fail(e, destination.path);
        }
        close(destination.fd);
    }
    void openFailed(int, const std::string& directoryPath, const std::string& name, int e) override {
        _fail(e, joinPath(directoryPath, name));
    }
    void readFailed(const std::string& path, int e) override { _fail(e, path); }
    bool shouldStop() const override { return error != 0; }

private:
    void _fail(int e, std::string path) {
        if (!error) {
            error = e;
            failedPath = std::move(path);
        }
    }
};

// The file-copy routine: answers 0 or the errno of the first item that could not be copied.
int copyTree(const std::string& source, const std::string& destination) {
    struct stat st;
    if (lstat(source.c_str(), &st) != 0)
        return errno;
    if (!S_ISDIR(st.st_mode))
        return copyItem(AT_FDCWD, "", source, st, AT_FDCWD, "", destination);
    STWFileDescriptor sourceFd(open(source.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!sourceFd)
        return errno;
    if (mkdir(destination.c_str(), 0700) != 0 && errno != EEXIST)
        return errno;
    int destinationFd = open(destination.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (destinationFd < 0)
        return errno;
    CopyContext context;
    context.destinations.push_back({destinationFd, destination});
    STWDirectoryWalker().walk(sourceFd.get(), source, context);
    if (context.error) {
        STW_LOG_ERROR(STWLogCategory::FS, "Copying %s stopped at %s: %s", source, context.failedPath,
                      strerror(context.error));
        return context.error;
    }
    if (fstat(sourceFd.get(), &st) != 0)
        return errno;
    return copyMetadata(sourceFd.get(), destinationFd, st, true);
}

// MARK: disk usage

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
int directoryStatistics(const std::string& path, DirectoryStatisticsMode mode, DirectoryStatistics* statistics) {
    if (mode == DirectoryStatisticsMode::FastOnly)
        return ENOTSUP;
    STWFileDescriptor fd(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
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

// MARK: real paths

// The root prefix as given and as the kernel resolves it; paths the daemon sees begin
// with one of them.
struct RootPrefix {
    std::string given;
    std::string real;
};

RootPrefix currentRootPrefix() {
    RootPrefix root;
    root.given = pathString(STWPlatformConfiguration::sharedInstance()->rootPrefix());
    char buffer[PATH_MAX] = {};
    root.real = realpath(root.given.c_str(), buffer) ? std::string(buffer) : root.given;
    return root;
}

bool isBelow(const std::string& path, const std::string& directory) {
    if (directory == "/")
        return hasPrefix(path, "/");
    return hasPrefix(path, directory) && (path.size() == directory.size() || path[directory.size()] == '/');
}

// Drops "/private" from the front of the part of `path` below the root prefix.
std::string strippingPrivate(const std::string& path, const RootPrefix& root) {
    size_t at = 0;
    if (root.given != "/" && isBelow(path, root.given))
        at = root.given.size();
    else if (root.real != "/" && isBelow(path, root.real))
        at = root.real.size();
    if (path.compare(at, 9, "/private/") == 0)
        return path.substr(0, at) + path.substr(at + 8);
    return path;
}

} // namespace

// MARK: -

STWFileManager* STWFileManager::defaultManager() {
    static STWFileManager* manager = new STWFileManager;
    return manager;
}

void STWFileManager::setSyncObserverForTesting(std::function<void(const std::string& path)> observer) {
    std::lock_guard guard(syncObserverMutex);
    syncObserver = std::move(observer);
}

fs::path STWFileManager::homeDirectoryURLForPOSIXUID(uid_t uid) {
    auto configuration = STWPlatformConfiguration::sharedInstance();
    auto user = STWUserDatabase::userWithUID(uid);
    if (!user) {
        STW_LOG_ERROR(STWLogCategory::FS, "Failed to getpwuid for uid: %u", uid);
    } else if (user->homeDirectory.is_absolute()) {
        char real[PATH_MAX] = {};
        if (realpath(user->homeDirectory.c_str(), real))
            return pathString(real);
    }
    STW_LOG_ERROR(STWLogCategory::FS, "Failed to get home dir using getpwuid for uid: %u", uid);
    return configuration->resolve("/private/var/mobile");
}

bool STWFileManager::removeItemAtURL(const fs::path& url, STWErrorRef* error) const {
    if (url.empty()) {
        STWSetError(error, STW_POSIX_ERROR(EFAULT, "nil url passed to -removeItemAtURL:error:"));
        return false;
    }
    std::string path = pathString(url);
    RemovalContext context;
    int e = removeTree(path, context);
    if (e && e != ENOENT) {
        STWSetError(error, STW_POSIX_ERROR(e, "removefile of %@ failed: %s", path, strerror(e)));
        return false;
    }
    if (context.recordedError == 0 || context.recordedError == ENOENT)
        return true;
    e = context.recordedError;
    STWSetError(error, STW_POSIX_ERROR(e, "removefile of %@ failed: %s", path, strerror(e)));
    return false;
}

namespace {

// The make-path routine: 0, EEXIST when the directory was there, or the errno.
int makePath(const std::string& path, mode_t mode) {
    if (mkdir(path.c_str(), mode) == 0)
        return 0;
    int e = errno;
    if (e == EEXIST) {
        struct stat st;
        return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode) ? EEXIST : ENOTDIR;
    }
    if (e != ENOENT)
        return e;
    std::string parent = fs::path(path).parent_path().native();
    if (parent.empty() || parent == path)
        return e;
    e = makePath(parent, mode | S_IWUSR | S_IXUSR);
    if (e && e != EEXIST)
        return e;
    if (mkdir(path.c_str(), mode) == 0)
        return 0;
    e = errno;
    if (e == EEXIST) { // made by someone else meanwhile
        struct stat st;
        return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode) ? EEXIST : ENOTDIR;
    }
    return e;
}

} // namespace

bool STWFileManager::createDirectoryAtURL(const fs::path& url, bool withIntermediateDirectories, mode_t mode,
                                          uid_t owner, int32_t dataProtectionClass, STWErrorRef* error) const {
    std::string path = pathString(url);
    if (withIntermediateDirectories) {
        int e = makePath(path, mode);
        if (e && e != EEXIST) {
            STWSetError(error, STW_POSIX_ERROR(e, "mkpath_np of %s failed: %s", path, strerror(e)));
            return false;
        }
    } else if (mkdir(path.c_str(), mode) != 0) {
        int e = errno;
        struct stat st;
        if (e == EEXIST && !(stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode)))
            e = ENOTDIR;
        if (e != EEXIST) {
            STWSetError(error, STW_POSIX_ERROR(e, "mkdir of %s failed: %s", path, strerror(e)));
            return false;
        }
    }
    if (dataProtectionClass == STWFileManagerClassUnchanged && owner == STWFileManagerOwnerUnchanged)
        return true;
    // Owner and class go through one descriptor that does not follow a link, so a link
    // planted in place of the directory cannot hand them to its target.
    STWFileDescriptor fd(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!fd) {
        int e = errno;
        STWSetError(error, STW_POSIX_ERROR(e, "opendir of %s failed: %s", path, strerror(e)));
        return false;
    }
    return setOwnerAndClassOfDirectory(fd.get(), owner, dataProtectionClass, path, __func__, error);
}

bool STWFileManager::createDirectoryAtURL(const fs::path& url, bool withIntermediateDirectories, mode_t mode,
                                          STWErrorRef* error) const {
    return createDirectoryAtURL(url, withIntermediateDirectories, mode, STWFileManagerOwnerUnchanged,
                                STWFileManagerClassUnchanged, error);
}

// For the "if exists" forms of copy and move: whether `source` is there (a missing source
// is nothing to do), or nullopt with `error` set when it cannot be examined.
static std::optional<bool> sourceExists(const std::string& source, const char* function, STWErrorRef* error) {
    struct stat st;
    if (lstat(source.c_str(), &st) == 0)
        return true;
    int e = errno;
    if (e == ENOENT)
        return false;
    STWSetError(error, STWErrorCreate(STWPOSIXErrorDomain, e, function, __LINE__, nullptr, true,
                                      "stat of %@ failed: %s", source, strerror(e)));
    return std::nullopt;
}

bool STWFileManager::_copyItemAtURL(const fs::path& url, const fs::path& toURL, bool failIfSrcMissing,
                                    STWErrorRef* error) const {
    std::string source = pathString(url);
    std::string destination = pathString(toURL);
    if (!failIfSrcMissing) {
        std::optional<bool> exists = sourceExists(source, __func__, error);
        if (!exists || !*exists)
            return exists.has_value();
    }
    if (int e = copyTree(source, destination)) {
        STWSetError(error,
                    STW_POSIX_ERROR(e, "copyfile of %@ to %@ failed: %s", source, destination, strerror(e)));
        return false;
    }
    return true;
}

bool STWFileManager::copyItemAtURL(const fs::path& url, const fs::path& toURL, STWErrorRef* error) const {
    return _copyItemAtURL(url, toURL, true, error);
}

bool STWFileManager::copyItemIfExistsAtURL(const fs::path& url, const fs::path& toURL, STWErrorRef* error) const {
    return _copyItemAtURL(url, toURL, false, error);
}

bool STWFileManager::_moveItemAtURL(const fs::path& url, const fs::path& toURL, bool failIfSrcMissing,
                                    STWFileManagerMoveOptions options, STWErrorRef* error) const {
    std::string source = pathString(url);
    std::string destination = pathString(toURL);
    if (!failIfSrcMissing) {
        std::optional<bool> exists = sourceExists(source, __func__, error);
        if (!exists || !*exists)
            return exists.has_value();
    }
    bool durable = options & STWFileManagerMoveDurable;
    // What is moved must be on disk before the rename that makes it visible can be.
    if (durable) {
        int e = syncTree(source);
        if (e && e != ENOENT) { // a missing source is left to rename to report
            STWSetError(error, STW_POSIX_ERROR(e, "Failed to sync %@ before moving it to %@: %s", source,
                                               destination, strerror(e)));
            return false;
        }
    }
    if (rename(source.c_str(), destination.c_str()) == 0) {
        if (!durable)
            return true;
        std::string from = parentPath(source), to = parentPath(destination);
        int e = syncDirectoryAtPath(to);
        if (!e && from != to)
            e = syncDirectoryAtPath(from);
        if (e) {
            STWSetError(error, STW_POSIX_ERROR(e, "Failed to sync the directories of %@ after moving it from %@: %s",
                                               destination, source, strerror(e)));
            return false;
        }
        return true;
    }
    int e = errno;
    if (e != EXDEV) {
        STWSetError(error,
                    STW_POSIX_ERROR(e, "rename of %@ to %@ failed: %s", source, destination, strerror(e)));
        return false;
    }
    if (!_copyItemAtURL(url, toURL, true, error))
        return false;
    if (durable) {
        int syncError = syncTree(destination);
        if (!syncError)
            syncError = syncDirectoryAtPath(parentPath(destination));
        if (syncError) {
            STWSetError(error, STW_POSIX_ERROR(syncError, "Failed to sync %@ after copying it from %@: %s",
                                               destination, source, strerror(syncError)));
            return false;
        }
    }
    STWErrorRef removeError;
    if (!removeItemAtURL(url, &removeError)) {
        STW_LOG_ERROR(STWLogCategory::FS, "Failed to remove move source after copy at %@ : %@", source, removeError);
    } else if (durable) {
        if (int syncError = syncDirectoryAtPath(parentPath(source)))
            STW_LOG_ERROR(STWLogCategory::FS, "Failed to sync %s after removing %@: %s", parentPath(source), source,
                          strerror(syncError));
    }
    return true;
}

bool STWFileManager::moveItemAtURL(const fs::path& url, const fs::path& toURL, STWErrorRef* error) const {
    return _moveItemAtURL(url, toURL, true, STWFileManagerMoveDefault, error);
}

bool STWFileManager::moveItemAtURL(const fs::path& url, const fs::path& toURL, STWFileManagerMoveOptions options,
                                   STWErrorRef* error) const {
    return _moveItemAtURL(url, toURL, true, options, error);
}

bool STWFileManager::moveItemIfExistsAtURL(const fs::path& url, const fs::path& toURL, STWErrorRef* error) const {
    return _moveItemAtURL(url, toURL, false, STWFileManagerMoveDefault, error);
}

bool STWFileManager::moveItemIfExistsAtURL(const fs::path& url, const fs::path& toURL,
                                           STWFileManagerMoveOptions options, STWErrorRef* error) const {
    return _moveItemAtURL(url, toURL, false, options, error);
}

std::optional<fs::path> STWFileManager::createTemporaryDirectoryInDirectoryURL(const fs::path& url,
                                                                               const std::string& withNamePrefix,
                                                                               STWErrorRef* error) const {
    STWSetError(error, nullptr);
    std::string templ = joinPath(pathString(url), STWFormat("%@XXXXXX", withNamePrefix));
    // mkdtemp() leaves its last attempt in the buffer when it fails; the error names the
    // template that was asked for.
    std::string path = templ;
    if (!mkdtemp(path.data())) {
        int e = errno;
        STWSetError(error, STW_POSIX_ERROR(e, "Failed to create temp dir at path %s : %s", templ, strerror(e)));
        return std::nullopt;
    }
    return fs::path(path);
}

std::optional<fs::path> STWFileManager::createTemporaryDirectoryInDirectoryURL(const fs::path& url,
                                                                               STWErrorRef* error) const {
    return createTemporaryDirectoryInDirectoryURL(url, "temp.", error);
}

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
    std::string path = pathString(url);
    std::vector<DirectoryItem> items;
    bool listed = _forEachItemInDirectory(path, __func__, error, [&](int directory, const dirent& entry) {
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
    DIR* directory = opendir(path.c_str());
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

bool STWFileManager::dataProtectionClassOfItemAtURL(const fs::path& url, int32_t* dataProtectionClass,
                                                    STWErrorRef* error) const {
    std::string path = pathString(url);
    // O_NONBLOCK: a FIFO in a container must not hang the daemon.
    STWFileDescriptor fd(open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    if (!fd) {
        int e = errno;
        STWSetError(error, STW_POSIX_ERROR(e, "Failed to open %s : %s", path, strerror(e)));
        return false;
    }
    int32_t value = 0;
    if (int e = readProtectionClass(fd.get(), &value)) {
        STWSetError(error, STW_POSIX_ERROR(e, "Failed to getclass of file %s: %s", path, strerror(e)));
        return false;
    }
    if (dataProtectionClass)
        *dataProtectionClass = value;
    return true;
}

bool STWFileManager::setDataProtectionClassOfItemAtURL(const fs::path& url, int32_t toClass,
                                                       const ClassPredicate& ifPredicate, STWErrorRef* error) const {
    std::string path = pathString(url);
    STWFileDescriptor fd(open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    if (!fd) {
        int e = errno;
        STWSetError(error, STW_POSIX_ERROR(e, "Failed to open %s : %s", path, strerror(e)));
        return false;
    }
    if (ifPredicate) {
        int32_t current = 0;
        if (int e = readProtectionClass(fd.get(), &current)) {
            STWSetError(error, STW_POSIX_ERROR(e, "Failed to getclass of file %s: %s", path, strerror(e)));
            return false;
        }
        if (!ifPredicate(current))
            return true;
    }
    if (int e = writeProtectionClass(fd.get(), toClass)) {
        STWSetError(error,
                    STW_POSIX_ERROR(e, "Failed to setclass(%d) on file %s: %s", toClass, path, strerror(e)));
        return false;
    }
    return true;
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

uint64_t STWFileManager::fastDiskUsageForURL(const fs::path& url) const {
    if (!STWPlatformConfiguration::sharedInstance()->isFeatureEnabled("fast_container_sizing"))
        return diskUsageForURL(url);
    std::string path = pathString(url);
    TraceInterval trace("CalculatingDiskUsage", path);
    DirectoryStatistics statistics;
    int e = directoryStatistics(path, DirectoryStatisticsMode::FastOnly, &statistics);
    if (e == ENOTSUP) {
        if (int m = maintainDirectoryStatistics(path)) {
            STW_LOG_ERROR(STWLogCategory::FS, "Failed to set maintain-dir-stats on %s: (err %d) %s", path, m,
                          strerror(m));
            trace.end(path, 0);
            return diskUsageForURL(url);
        }
        STW_LOG_NOTICE(STWLogCategory::FS, "Enabled fast directory sizing on [%s]", path);
        e = directoryStatistics(path, DirectoryStatisticsMode::FastOnly, &statistics);
    }
    if (e) {
        STW_LOG_ERROR(STWLogCategory::FS, "Failed to get dirstats on %s: (err %d) %s", path, e, strerror(e));
        trace.end(path, 0);
        return diskUsageForURL(url);
    }
    if (statistics.totalSize < 0) {
        STW_LOG_ERROR(STWLogCategory::FS, "Invalid size (%lld) from dirstats on %s: (err %d) %s",
                      statistics.totalSize, path, 0, strerror(0));
        trace.end(path, statistics.descendants);
        return diskUsageForURL(url);
    }
    uint64_t size = static_cast<uint64_t>(statistics.totalSize);
    STW_LOG_INFO(STWLogCategory::FS, "[%s]: descendants: %llu, total size: %llu", path, statistics.descendants,
                 size);
    trace.end(path, statistics.descendants, size);
    return size;
}

uint64_t STWFileManager::diskUsageForURL(const fs::path& url) const {
    std::string path = pathString(url);
    TraceInterval trace("CalculatingDiskUsage", path);
    if (path.empty()) {
        STW_LOG_ERROR(STWLogCategory::FS, "Failed to get path to url %@", path);
        trace.end(path, 0);
        return 0;
    }
    DirectoryStatistics statistics;
    if (int e = directoryStatistics(path, DirectoryStatisticsMode::ForcedWalk, &statistics)) {
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

std::optional<fs::path> STWFileManager::_realPathForURL(const fs::path& url,
                                                        bool allowNonExistentPathComponents) const {
    std::string path = pathString(url);
    char buffer[PATH_MAX] = {};
    if (realpath(path.c_str(), buffer))
        return fs::path(buffer);
    int e = errno;
    if (e == ENOENT && allowNonExistentPathComponents)
        return _realPathWhatExistsInPath(path);
    // glibc leaves the part it resolved in the buffer.
    STW_LOG_ERROR(STWLogCategory::FS, "Failed to realpath %s : %s at %s", path, strerror(e), buffer);
    return std::nullopt;
}

std::optional<fs::path> STWFileManager::_realPathWhatExistsInPath(const std::string& path) const {
    std::vector<std::string> components = pathComponents(path);
    for (size_t count = components.size(); count >= 2; --count) {
        std::string prefix = joinComponents(components, 0, count);
        if (!itemExistsAtURL(prefix))
            continue;
        auto real = _realPathForURL(prefix, false);
        if (!real)
            continue;
        std::string rest = joinComponents(components, count, components.size());
        STW_LOG_DEBUG(STWLogCategory::FS, "Realpathed %@ ; appending non-existing components %@", *real, rest);
        return rest.empty() ? *real : *real / rest;
    }
    return std::nullopt;
}

bool STWFileManager::_validateSymlink(std::string_view path, int32_t withStartingDepth, int32_t* andEndingDepth) {
    int32_t depth = withStartingDepth;
    size_t start = 0;
    while (start <= path.size()) {
        size_t end = path.find('/', start);
        if (end == std::string_view::npos)
            end = path.size();
        std::string_view component = path.substr(start, end - start);
        start = end + 1;
        if (component == "..")
            --depth;
        else if (!component.empty() && component != ".")
            ++depth;
        if (depth < withStartingDepth)
            return false;
    }
    if (andEndingDepth)
        *andEndingDepth = depth;
    return true;
}

std::optional<fs::path> STWFileManager::realPathForURL(const fs::path& url, const fs::path& ifChildOfURL) const {
    if (url.empty() || ifChildOfURL.empty()) {
        STW_LOG_ERROR(STWLogCategory::FS, "The base path %@ and/or suspicious path %@ were nil", ifChildOfURL, url);
        return std::nullopt;
    }
    RootPrefix root = currentRootPrefix();
    std::string suspiciousGiven = pathString(url);
    std::string baseGiven = pathString(ifChildOfURL);
    std::string suspicious = strippingPrivate(suspiciousGiven, root);
    std::string base = strippingPrivate(baseGiven, root);
    if (!hasPrefix(suspicious, base)) {
        STW_LOG_ERROR(STWLogCategory::FS, "supiscious path %@ does not contain base path %@ as a prefix", suspicious,
                      base);
        return std::nullopt;
    }
    if (containsDotDotPathComponents(suspicious)) {
        STW_LOG_ERROR(STWLogCategory::FS, "The suspicious path %@ contains '..' paths, which are invalid", suspicious);
        return std::nullopt;
    }

    // The string tests above work on the stripped forms; the file system is asked about the
    // paths as given, which name the same items where /var leads to /private/var and are
    // the only ones that exist where it does not.
    char link[1024] = {};
    ssize_t length = readlink(suspiciousGiven.c_str(), link, sizeof link - 1);
    if (length < 0) {
        if (errno != EINVAL && errno != ENOENT) {
            STW_LOG_ERROR(STWLogCategory::FS, "Readlink failed: %s", strerror(errno));
            return std::nullopt;
        }
    } else {
        std::string target(link, static_cast<size_t>(length));
        if (hasPrefix(target, "/")) {
            STW_LOG_ERROR(STWLogCategory::FS, "Rejecting %@ -> %s, as absolute symlinks are not allowed", suspicious,
                          target);
            return std::nullopt;
        }
        int32_t baseDepth = 0;
        if (!_validateSymlink(base, 0, &baseDepth)) {
            STW_LOG_ERROR(STWLogCategory::FS, "Failed to retrieve depth of %@", base);
            return std::nullopt;
        }
        std::string belowBase = suspicious.substr(base.size());
        size_t slash = belowBase.rfind('/');
        std::string resolved = (slash == std::string::npos ? std::string() : belowBase.substr(0, slash)) + "/" + target;
        if (!_validateSymlink(resolved, baseDepth, nullptr)) {
            STW_LOG_ERROR(STWLogCategory::FS, "Rejecting %@ -> %@, as it is points outside or to the base %@",
                          suspicious, resolved, base);
            return std::nullopt;
        }
    }

    auto baseReal = _realPathForURL(baseGiven, false);
    if (!baseReal) {
        STW_LOG_ERROR(STWLogCategory::FS, "Failed to retrieve realpath for base path %@ ", base);
        return std::nullopt;
    }
    auto suspiciousReal = _realPathForURL(suspiciousGiven, true);
    if (!suspiciousReal) {
        STW_LOG_ERROR(STWLogCategory::FS, "Failed to retrieve realpath for suspicious path %@", suspicious);
        return std::nullopt;
    }

    // A relative link that passed the lexical test above is compared too: a link further up
    // the path (resolved by realpath, not seen by readlink) could still have led it out.
    std::vector<std::string> baseComponents = pathComponents(baseReal->native());
    std::vector<std::string> childComponents = pathComponents(suspiciousReal->native());
    if (baseComponents.size() < 2 || childComponents.size() < 2) {
        STW_LOG_ERROR(STWLogCategory::FS,
                      "Rejecting %@ with base %@ because real component counts don't make sense (reals %@ ; %@)",
                      suspicious, base, *suspiciousReal, *baseReal);
        return std::nullopt;
    }
    // Both sides are compared below the root prefix, each skipping a leading "private".
    std::vector<std::string> rootComponents = pathComponents(root.real);
    auto startIndex = [&](const std::vector<std::string>& components) -> std::optional<size_t> {
        for (size_t i = 0; i < rootComponents.size(); ++i)
            if (i >= components.size() || components[i] != rootComponents[i])
                return std::nullopt;
        size_t start = rootComponents.size();
        return start < components.size() && components[start] == "private" ? start + 1 : start;
    };
    auto baseStart = startIndex(baseComponents);
    auto childStart = startIndex(childComponents);
    if (!baseStart || !childStart) {
        STW_LOG_ERROR(STWLogCategory::FS, "Rejecting %@ with base %@ (reals %@ ; %@) because it lies outside %@",
                      suspicious, base, *suspiciousReal, *baseReal, root.real);
        return std::nullopt;
    }
    // Real paths of one place agree on "/private" (realpath resolves /var through it); on
    // Linux, where /var may be a directory of its own, a disagreement means two places.
    if ((*baseStart > rootComponents.size()) != (*childStart > rootComponents.size())) {
        STW_LOG_ERROR(STWLogCategory::FS, "Rejecting %@ with base %@ (reals %@ ; %@) because only one is in /private",
                      suspicious, base, *suspiciousReal, *baseReal);
        return std::nullopt;
    }
    size_t baseLeft = baseComponents.size() - *baseStart;
    size_t childLeft = childComponents.size() - *childStart;
    if (baseLeft > childLeft) {
        STW_LOG_ERROR(STWLogCategory::FS,
                      "Rejecting %@ with base %@ because base component count is greater than child component count "
                      "(reals %@ ; %@)",
                      suspicious, base, *suspiciousReal, *baseReal);
        return std::nullopt;
    }
    for (size_t i = 0; i < baseLeft; ++i) {
        const std::string& expected = baseComponents[*baseStart + i];
        const std::string& actual = childComponents[*childStart + i];
        if (expected != actual) {
            STW_LOG_ERROR(STWLogCategory::FS,
                          "Rejecting %@ with base %@ (reals %@ ; %@) because components diverge at %@ != %@",
                          suspicious, base, *suspiciousReal, *baseReal, expected, actual);
            return std::nullopt;
        }
    }
    return suspiciousReal;
}

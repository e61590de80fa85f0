// Copy and move: recursive copies with ownership, modes, ACLs and attributes; renames made
// durable on request, and copy-then-remove across file systems.
#include "Daemon/FileSystem/STWFileManager.h"

#include "Daemon/FileSystem/STWDirectoryWalker.h"
#include "Daemon/FileSystem/STWFileSystemPrimitives.h"
#include "common/STWFileIO.h"
#include "common/STWLog.h"
#include "common/STWSystemCall.h"

#include <acl/libacl.h>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/acl.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>
#include <vector>

namespace fs = std::filesystem;
using namespace STWFileSystemPrimitives;

namespace {

constexpr const char* kAccessACLAttribute = "system.posix_acl_access";
constexpr const char* kDefaultACLAttribute = "system.posix_acl_default";

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
        return byPath ? disk::lsetxattr(destinationPath.c_str(), name, value, size, 0)
                      : disk::fsetxattr(destinationFd, name, value, size, 0);
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
        bool set = !disk::injected(STWFaultPoint::SetAttribute) && acl_set_fd(destinationFd, acl) == 0;
        int e = set ? 0 : errno;
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
    if (disk::fsetxattr(destinationFd, kDefaultACLAttribute, value.data(), static_cast<size_t>(size), 0) != 0 &&
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
    if (disk::fchown(destinationFd, st.st_uid, st.st_gid) != 0)
        if (int e = copyOwner(errno))
            return e;
    if (disk::fchmod(destinationFd, st.st_mode & 07777) != 0)
        return errno;
    if (int e = copyExtendedAttributes(sourceFd, destinationFd, {}, {}))
        return e;
    return copyACLs(sourceFd, destinationFd, isDirectory);
}

int copyData(int sourceFd, int destinationFd) {
    if (int e = STWFaultInjection::check(STWFaultPoint::Write))
        return e;
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
        ssize_t n = STWRetryOnEINTR([&] { return read(sourceFd, buffer.data(), buffer.size()); });
        if (n <= 0)
            return n < 0 ? errno : 0;
        if (int e = STWWriteAll(destinationFd, std::string_view(buffer.data(), static_cast<size_t>(n))))
            return e;
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
    int flags = O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_NOCTTY | O_CLOEXEC;
    STWFileDescriptor out(disk::openat(destinationDirfd, destinationName.c_str(), flags, 0600));
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
    if (disk::symlinkat(target.c_str(), destinationDirfd, destinationName.c_str()) != 0) {
        if (errno != EEXIST)
            return errno;
        struct stat existing;
        if (fstatat(destinationDirfd, destinationName.c_str(), &existing, AT_SYMLINK_NOFOLLOW) == 0 &&
            S_ISDIR(existing.st_mode))
            return EEXIST;
        if (disk::unlinkat(destinationDirfd, destinationName.c_str(), 0) != 0 ||
            disk::symlinkat(target.c_str(), destinationDirfd, destinationName.c_str()) != 0)
            return errno;
    }
    if (disk::fchownat(destinationDirfd, destinationName.c_str(), st.st_uid, st.st_gid,
                       AT_SYMLINK_NOFOLLOW) != 0)
        if (int e = copyOwner(errno))
            return e;
    return copyExtendedAttributes(-1, -1, joinPath(sourceDirectory, sourceName),
                                  joinPath(destinationDirectory, destinationName));
}

int copySpecialFile(const std::string& sourceDirectory, const std::string& sourceName, const struct stat& st,
                    int destinationDirfd, const std::string& destinationDirectory,
                    const std::string& destinationName) {
    if (disk::mknodat(destinationDirfd, destinationName.c_str(), st.st_mode & (S_IFMT | 0600),
                      st.st_rdev) != 0)
        return errno;
    if (disk::fchownat(destinationDirfd, destinationName.c_str(), st.st_uid, st.st_gid,
                       AT_SYMLINK_NOFOLLOW) != 0)
        if (int e = copyOwner(errno))
            return e;
    // AT_SYMLINK_NOFOLLOW: a link swapped in for the new node must not have its target chmodded.
    if (disk::fchmodat(destinationDirfd, destinationName.c_str(), st.st_mode & 07777,
                       AT_SYMLINK_NOFOLLOW) != 0)
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
        if (disk::mkdirat(destinationDirfd, destinationName.c_str(), 0700) != 0 && errno != EEXIST)
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
    if (disk::mkdirat(AT_FDCWD, destination.c_str(), 0700) != 0 && errno != EEXIST)
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

// For the "if exists" forms of copy and move: nullopt when the operation should go on,
// else what it answers: true for a missing source (nothing to do), false with `error` set
// when the source cannot be examined.
std::optional<bool> answerWithoutSource(const std::string& source, bool failIfSrcMissing, const char* function,
                                        STWErrorRef* error) {
    struct stat st;
    if (failIfSrcMissing || lstat(source.c_str(), &st) == 0)
        return std::nullopt;
    int e = errno;
    if (e == ENOENT)
        return true;
    STWSetError(error, STWErrorCreate(STWPOSIXErrorDomain, e, function, __LINE__, nullptr, true,
                                      "stat of %@ failed: %s", source, strerror(e)));
    return false;
}

} // namespace

bool STWFileManager::_copyItemAtURL(const fs::path& url, const fs::path& toURL, bool failIfSrcMissing,
                                    STWErrorRef* error) const {
    std::string source = pathString(url);
    std::string destination = pathString(toURL);
    if (auto answer = answerWithoutSource(source, failIfSrcMissing, __func__, error))
        return *answer;
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
    if (auto answer = answerWithoutSource(source, failIfSrcMissing, __func__, error))
        return *answer;
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
    if (disk::renameat(AT_FDCWD, source.c_str(), AT_FDCWD, destination.c_str()) == 0) {
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

// The small system-call helpers that the sources of STWFileManager share: path pieces,
// durability (with the test observer of every sync), protection-class attributes,
// the user-immutable inode flag, owner and class of a directory through its descriptor,
// trace intervals, and the system calls that change the disk, each behind its fault-injection
// point. Internal to the file layer; everyone else goes through STWFileManager.
//
// The helpers answer 0 or the errno value (setOwnerAndClassOfDirectory, which serves the
// public operations directly, an error object); the disk:: calls below stand in for the
// system calls and answer exactly as they do. STWFileManager turns either into a
// POSIX-domain error carrying the errno.
#pragma once

#include "Daemon/FileSystem/STWFaultInjection.h"
#include "common/STWError.h"

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <filesystem>
#include <optional>
#include <string>
#include <string_view>
#include <sys/stat.h>
#include <sys/types.h>
#include <sys/xattr.h>
#include <unistd.h>
#include <vector>

namespace STWFileSystemPrimitives {

std::string joinPath(const std::string& directory, const std::string& name);
// "/" followed by the non-empty components, as the real-path checks count them.
std::vector<std::string> pathComponents(std::string_view path);
bool hasPrefix(std::string_view text, std::string_view prefix);
// The path as the daemon names it: no trailing separator (except for "/" itself).
std::string pathString(const std::filesystem::path& url);
// The directory that holds `path`; "." for a bare name.
std::string parentPath(const std::filesystem::path& path);
// Whether two stats describe the same inode.
inline bool sameItem(const struct stat& a, const struct stat& b) {
    return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}
// The name under which /proc reaches the very inode open as `fd` (also an O_PATH one).
std::string procfsPath(int fd);
// Where the kernel says the item open as `fd` is now; nullopt when it cannot say (the item
// was removed, or lies outside this mount namespace). Only fit for comparing and naming:
// acting again goes through descriptors.
std::optional<std::filesystem::path> currentPathOfDescriptor(int fd);

// fsync, reported to the test observer under `path`. 0 or the errno.
int syncDescriptor(int fd, const std::string& path);
int syncDirectoryAtPath(const std::string& path);
// Every regular file and directory of the tree open as `fd`, the directories after their
// contents.
int syncTreeAt(int fd, const std::string& path);
// The same for the item at `path`; a symbolic link there is nothing to sync.
int syncTree(const std::string& path);

// The item's protection class (0 when it has none); class 1 items answer EPERM while the
// device is locked.
int readProtectionClass(int fd, int32_t* dataProtectionClass);
int writeProtectionClass(int fd, int32_t dataProtectionClass);

// The user-immutable inode flag. setUserImmutable answers the errno; flagsUnsupported()
// tells the errors of a file system that has no such flag.
int setUserImmutable(int fd, bool immutable);
bool isUserImmutable(int fd);
bool flagsUnsupported(int e);

// Errors carry `function`, the public operation that asked.
bool setOwnerAndClassOfDirectory(int fd, uid_t owner, int32_t dataProtectionClass, const std::string& path,
                                 const char* function, STWErrorRef* error);

// A trace interval: a debug line at each end (the toolchain has no USDT probes).
class TraceInterval {
public:
    TraceInterval(const char* name, const std::string& path);
    void end(const std::string& path, uint64_t nodes, std::optional<uint64_t> size = std::nullopt);

private:
    const char* _name;
};

// MARK: calls that change the disk
//
// The file layer makes every system call that changes the disk through these (path forms
// as the *at form with AT_FDCWD), so that a test can make any of them fail. An armed fault
// answers as the failed call would, -1 or nullptr with errno set, without making the call.
// Calls that answer an errno check their point with STWFaultInjection::check() instead.
namespace disk {

inline bool injected(STWFaultPoint point) {
    int e = STWFaultInjection::check(point);
    if (e)
        errno = e;
    return e != 0;
}

inline int mkdirat(int dirfd, const char* path, mode_t mode) {
    return injected(STWFaultPoint::MakeDirectory) ? -1 : ::mkdirat(dirfd, path, mode);
}
inline char* mkdtemp(char* pathTemplate) {
    return injected(STWFaultPoint::MakeDirectory) ? nullptr : ::mkdtemp(pathTemplate);
}
// Only an open that may create passes the point.
inline int openat(int dirfd, const char* path, int flags, mode_t mode) {
    return (flags & O_CREAT) && injected(STWFaultPoint::Create) ? -1 : ::openat(dirfd, path, flags, mode);
}
inline int symlinkat(const char* target, int dirfd, const char* path) {
    return injected(STWFaultPoint::Create) ? -1 : ::symlinkat(target, dirfd, path);
}
inline int mknodat(int dirfd, const char* path, mode_t mode, dev_t device) {
    return injected(STWFaultPoint::Create) ? -1 : ::mknodat(dirfd, path, mode, device);
}
inline int renameat(int fromfd, const char* from, int tofd, const char* to) {
    return injected(STWFaultPoint::Rename) ? -1 : ::renameat(fromfd, from, tofd, to);
}
inline int renameat2(int fromfd, const char* from, int tofd, const char* to, unsigned flags) {
    return injected(STWFaultPoint::Rename) ? -1 : ::renameat2(fromfd, from, tofd, to, flags);
}
inline int unlinkat(int dirfd, const char* path, int flags) {
    return injected(STWFaultPoint::Remove) ? -1 : ::unlinkat(dirfd, path, flags);
}
inline int fchown(int fd, uid_t owner, gid_t group) {
    return injected(STWFaultPoint::ChangeOwner) ? -1 : ::fchown(fd, owner, group);
}
inline int fchownat(int dirfd, const char* path, uid_t owner, gid_t group, int flags) {
    return injected(STWFaultPoint::ChangeOwner) ? -1 : ::fchownat(dirfd, path, owner, group, flags);
}
inline int fchmod(int fd, mode_t mode) {
    return injected(STWFaultPoint::ChangeMode) ? -1 : ::fchmod(fd, mode);
}
inline int fchmodat(int dirfd, const char* path, mode_t mode, int flags) {
    return injected(STWFaultPoint::ChangeMode) ? -1 : ::fchmodat(dirfd, path, mode, flags);
}
inline int fsetxattr(int fd, const char* name, const void* value, size_t size, int flags) {
    return injected(STWFaultPoint::SetAttribute) ? -1 : ::fsetxattr(fd, name, value, size, flags);
}
inline int lsetxattr(const char* path, const char* name, const void* value, size_t size, int flags) {
    return injected(STWFaultPoint::SetAttribute) ? -1 : ::lsetxattr(path, name, value, size, flags);
}

} // namespace disk

} // namespace STWFileSystemPrimitives

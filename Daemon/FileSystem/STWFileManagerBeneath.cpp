// Descriptor-relative operations below directories that someone else owns.
//
// Opening beneath a directory descriptor, making directories component by component,
// publishing a staged directory, and replacing a file of the daemon's own. See "Below a
// directory someone else owns" in STWFileManager.h.
#include "Daemon/FileSystem/STWFileManager.h"

#include "Daemon/FileSystem/STWFileSystemPrimitives.h"
#include "common/STWFormat.h"
#include "common/STWLog.h"
#include "common/STWFileIO.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace fs = std::filesystem;
using namespace STWFileSystemPrimitives;

namespace {

// How often a step is tried again while someone keeps swapping the item under it.
constexpr int kSwapRetries = 8;

// Opens the directory `name` of `at`, making it first when missing. A link in its place is
// removed (never followed) and the step tried again. 0 or the errno.
int openOrMakeDirectory(int at, const std::string& name, mode_t mode, const std::string& path, STWFileDescriptor* out) {
    for (int attempt = 0; attempt < kSwapRetries; ++attempt) {
        if (disk::mkdirat(at, name.c_str(), mode) != 0 && errno != EEXIST)
            return errno;
        int fd = openat(at, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
        if (fd >= 0) {
            out->reset(fd);
            return 0;
        }
        int e = errno;
        if (e == ENOENT)
            continue; // removed since: make it again
        if (e != ELOOP && e != ENOTDIR)
            return e;
        struct stat st;
        if (fstatat(at, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) {
            if (errno == ENOENT)
                continue;
            return errno;
        }
        if (S_ISDIR(st.st_mode))
            continue; // a directory again by now
        if (!S_ISLNK(st.st_mode))
            return ENOTDIR;
        STW_LOG_NOTICE(STWLogCategory::FS, "Removing the symbolic link found in place of directory %s", path);
        // A directory swapped back in meanwhile answers EISDIR and stays.
        if (disk::unlinkat(at, name.c_str(), 0) != 0 && errno != ENOENT && errno != EISDIR)
            return errno;
    }
    return ELOOP;
}

} // namespace

STWFileDescriptor STWFileManager::openBeneath(int dirfd, const std::string& relativePath, int flags, mode_t mode,
                                              unsigned options, STWErrorRef* error) const {
    static const std::string here = ".";
    const std::string& path = relativePath.empty() ? here : relativePath;
    struct open_how how = {};
    how.flags = static_cast<uint64_t>(flags | O_CLOEXEC);
    // O_TMPFILE includes O_DIRECTORY: test all of its bits.
    how.mode = ((flags & O_CREAT) || (flags & O_TMPFILE) == O_TMPFILE) ? mode : 0;
    how.resolve = RESOLVE_BENEATH | RESOLVE_NO_MAGICLINKS |
                  ((options & STWOpenBeneathNoSymlinks) ? RESOLVE_NO_SYMLINKS : 0);
    for (int attempt = 0;; ++attempt) {
        long fd = (flags & O_CREAT) && disk::injected(STWFaultPoint::Create)
                      ? -1
                      : syscall(SYS_openat2, dirfd, path.c_str(), &how, sizeof how);
        if (fd >= 0)
            return STWFileDescriptor(static_cast<int>(fd));
        int e = errno;
        // EAGAIN: a rename elsewhere raced the lookup and the kernel could not vouch for it.
        if (e == EINTR || (e == EAGAIN && attempt < 16))
            continue;
        if (e == ENOSYS)
            return _openBeneathByComponents(dirfd, relativePath, flags, mode, error);
        STWSetError(error, STW_POSIX_ERROR_NOLOG(e, "Failed to open %@ beneath descriptor %d: %s", path, dirfd,
                                                 strerror(e)));
        return {};
    }
}

STWFileDescriptor STWFileManager::_openBeneathByComponents(int dirfd, const fs::path& relativePath, int flags,
                                                           mode_t mode, STWErrorRef* error) const {
    const std::string& path = relativePath.native();
    // Each failure site passes its own line; the error names this operation, not the lambda.
    const char* function = __func__;
    auto fail = [&](int e, uint64_t line) {
        STWSetError(error, STWErrorCreate(STWPOSIXErrorDomain, e, function, line, nullptr, false,
                                          "Failed to open %@ beneath descriptor %d: %s", path, dirfd, strerror(e)));
        return STWFileDescriptor();
    };
    // Absolute paths and ".." answer EXDEV, as RESOLVE_BENEATH does for an escape; this walk
    // does not follow "..", even where it would stay inside.
    if (hasPrefix(path, "/"))
        return fail(EXDEV, __LINE__);
    std::vector<std::string> components;
    for (const std::string& component : pathComponents(path)) {
        if (component == "..")
            return fail(EXDEV, __LINE__);
        if (component != ".")
            components.push_back(component);
    }
    if (components.empty()) {
        int fd = disk::openat(dirfd, ".", flags | O_CLOEXEC, mode);
        return fd < 0 ? fail(errno, __LINE__) : STWFileDescriptor(fd);
    }
    STWFileDescriptor current;
    int at = dirfd;
    for (size_t i = 0; i + 1 < components.size(); ++i) {
        int fd = openat(at, components[i].c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
        if (fd < 0) {
            int e = errno;
            struct stat st;
            // O_DIRECTORY answers ENOTDIR for a link; name it for what it is.
            if (e == ENOTDIR && fstatat(at, components[i].c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0 &&
                S_ISLNK(st.st_mode))
                e = ELOOP;
            return fail(e, __LINE__);
        }
        current.reset(fd);
        at = fd;
    }
    int fd = disk::openat(at, components.back().c_str(), flags | O_NOFOLLOW | O_CLOEXEC, mode);
    return fd < 0 ? fail(errno, __LINE__) : STWFileDescriptor(fd);
}

STWFileDescriptor STWFileManager::openDirectoryAtURL(const fs::path& url, STWErrorRef* error) const {
    STWFileDescriptor fd(open(url.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!fd) {
        int e = errno;
        STWSetError(error, STW_POSIX_ERROR(e, "opendir of %@ failed: %s", url, strerror(e)));
    }
    return fd;
}

STWFileDescriptor STWFileManager::openDirectoryAtURL(const fs::path& url, const fs::path& trustedAncestor,
                                                     STWErrorRef* error) const {
    fs::path relative = trustedAncestor.empty() ? fs::path() : url.lexically_relative(trustedAncestor);
    if (relative.empty() || *relative.begin() == "..")
        return openDirectoryAtURL(url, error);
    STWFileDescriptor ancestor(open(trustedAncestor.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!ancestor) {
        int e = errno;
        STWSetError(error, STW_POSIX_ERROR(e, "opendir of %@ failed: %s", trustedAncestor, strerror(e)));
        return {};
    }
    STWErrorRef openError;
    STWFileDescriptor fd =
        openBeneath(ancestor.get(), relative.native(), O_RDONLY | O_DIRECTORY, 0, STWOpenBeneathNoSymlinks, &openError);
    if (!fd) {
        // openBeneath() fails with an errno; an error of any other domain would go on as it
        // is rather than have its code taken for one.
        int e = openError->posixCode();
        STWSetError(error, e ? STWErrorCreate(STWPOSIXErrorDomain, e, __func__, __LINE__, openError, true,
                                              "opendir of %@ failed: %s", url, strerror(e))
                             : openError);
    }
    return fd;
}

STWFileDescriptor STWFileManager::createDirectoryBeneath(int dirfd, const fs::path& relativePath, mode_t mode,
                                                         uid_t owner, int32_t dataProtectionClass,
                                                         const fs::path& path, STWErrorRef* error) const {
    std::vector<std::string> components = pathComponents(relativePath.native());
    if (components.empty() || components.front() == "/" ||
        std::find(components.begin(), components.end(), "..") != components.end()) {
        STWSetError(error, STW_POSIX_ERROR(EINVAL, "mkpath_np of %@ failed: %s", path, strerror(EINVAL)));
        return {};
    }
    STWFileDescriptor current;
    int at = dirfd;
    for (size_t i = 0; i < components.size(); ++i) {
        bool last = i + 1 == components.size();
        STWFileDescriptor next;
        if (int e = openOrMakeDirectory(at, components[i], last ? mode : mode | S_IWUSR | S_IXUSR, path, &next)) {
            STWSetError(error, STW_POSIX_ERROR(e, "mkpath_np of %@ failed: %s", path, strerror(e)));
            return {};
        }
        current = std::move(next);
        at = current.get();
    }
    if (!setOwnerAndClassOfDirectory(current.get(), owner, dataProtectionClass, path, __func__, error))
        return {};
    return current;
}

STWFileDescriptor STWFileManager::createNewDirectoryAt(int dirfd, const std::string& name, mode_t mode, uid_t owner,
                                                       int32_t dataProtectionClass, const fs::path& path,
                                                       STWErrorRef* error) const {
    if (disk::mkdirat(dirfd, name.c_str(), mode) != 0) {
        int e = errno;
        STWSetError(error, STW_POSIX_ERROR(e, "mkdir of %@ failed: %s", path, strerror(e)));
        return {};
    }
    STWFileDescriptor fd(openat(dirfd, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    struct stat st;
    int e = !fd ? errno : fstat(fd.get(), &st) != 0 ? errno : st.st_uid != geteuid() ? ESTALE : 0;
    if (e) {
        STWSetError(error, STW_POSIX_ERROR(e, "The new directory %@ was replaced before it was opened: %s", path,
                                           strerror(e)));
        return {};
    }
    if (!setOwnerAndClassOfDirectory(fd.get(), owner, dataProtectionClass, path, __func__, error))
        return {};
    return fd;
}

std::optional<STWFileManager::TemporaryDirectory>
STWFileManager::createTemporaryDirectoryAt(int dirfd, const std::string& namePrefix, const fs::path& directory,
                                           STWErrorRef* error) const {
    static constexpr char kCharacters[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789";
    STWErrorRef makeError;
    for (int attempt = 0; attempt < kSwapRetries; ++attempt) {
        unsigned char random[6];
        if (getrandom(random, sizeof random, 0) != static_cast<ssize_t>(sizeof random)) {
            int e = errno;
            STWSetError(error, STW_POSIX_ERROR(e, "Failed to create temp dir in %@: %s", directory, strerror(e)));
            return std::nullopt;
        }
        std::string name = namePrefix;
        for (unsigned char byte : random)
            name += kCharacters[byte % (sizeof kCharacters - 1)];
        STWFileDescriptor fd = createNewDirectoryAt(dirfd, name, 0700, STWFileManagerOwnerUnchanged,
                                                    STWFileManagerClassUnchanged, directory / name, &makeError);
        if (fd)
            return TemporaryDirectory{std::move(fd), std::move(name)};
        if (!makeError || !makeError->isPOSIX(EEXIST))
            break;
    }
    STWSetError(error, makeError);
    return std::nullopt;
}

bool STWFileManager::moveDirectoryAt(int fromfd, const std::string& name, int tofd, const std::string& toName,
                                     int directoryfd, STWFileManagerMoveOptions options, const fs::path& from,
                                     const fs::path& to, STWErrorRef* error) const {
    bool durable = options & STWFileManagerMoveDurable;
    struct stat expected;
    int e = fstat(directoryfd, &expected) != 0 ? errno : durable ? syncTreeAt(directoryfd, from) : 0;
    if (e) {
        STWSetError(error, STW_POSIX_ERROR(e, "Failed to sync %@ before moving it to %@: %s", from, to, strerror(e)));
        return false;
    }
    if (disk::renameat2(fromfd, name.c_str(), tofd, toName.c_str(), RENAME_NOREPLACE) != 0) {
        e = errno;
        STWSetError(error, STW_POSIX_ERROR(e, "rename of %@ to %@ failed: %s", from, to, strerror(e)));
        return false;
    }
    struct stat arrived;
    if (fstatat(tofd, toName.c_str(), &arrived, AT_SYMLINK_NOFOLLOW) != 0 || !sameItem(arrived, expected)) {
        // Someone swapped the entry between our opening it and the rename: what arrived is
        // theirs. Send it back where it came from.
        if (disk::renameat2(tofd, toName.c_str(), fromfd, name.c_str(), RENAME_NOREPLACE) != 0)
            STW_LOG_ERROR(STWLogCategory::FS, "Failed to move back what was swapped in for %@ from %@: %s", from, to,
                          strerror(errno));
        STWSetError(error, STW_POSIX_ERROR(ESTALE, "rename of %@ to %@ moved another item: %s", from, to,
                                           strerror(ESTALE)));
        return false;
    }
    bool syncSource = durable || (options & (STWFileManagerMoveSyncDirectories | STWFileManagerMoveSyncSourceDirectory));
    bool syncDestination = durable || (options & STWFileManagerMoveSyncDirectories);
    if (!syncSource)
        return true;
    e = syncDestination ? syncDescriptor(tofd, parentPath(to)) : 0;
    if (!e && (!syncDestination || parentPath(to) != parentPath(from)))
        e = syncDescriptor(fromfd, parentPath(from));
    if (e) {
        // Not durable, so not done: the directory goes back, and the caller, told that the
        // move failed, finds it where it was. When it cannot go back, the move stands and
        // is answered as done: a caller told otherwise would leave it where it arrived.
        if (disk::renameat2(tofd, toName.c_str(), fromfd, name.c_str(), RENAME_NOREPLACE) != 0) {
            STW_LOG_ERROR(STWLogCategory::FS,
                          "Moved %@ to %@, but failed to sync the directories (%s) and to move it back: %s", from, to,
                          strerror(e), strerror(errno));
            return true;
        }
        STWSetError(error, STW_POSIX_ERROR(e, "Failed to sync the directories of %@ after moving it from %@: %s", to,
                                           from, strerror(e)));
        return false;
    }
    return true;
}

std::optional<STWFileManager::TemporaryFile> STWFileManager::writeTemporaryFileAt(int dirfd, std::string_view contents,
                                                                                  mode_t mode, const fs::path& directory,
                                                                                  STWErrorRef* error) const {
    TemporaryFile file;
    int e = EEXIST;
    for (int attempt = 0; attempt < kSwapRetries && e == EEXIST; ++attempt) {
        unsigned char random[6];
        if (getrandom(random, sizeof random, 0) != static_cast<ssize_t>(sizeof random)) {
            e = errno;
            break;
        }
        file.name = ".temp." + STWHexString(random, sizeof random);
        int flags = O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC;
        file.fd.reset(disk::openat(dirfd, file.name.c_str(), flags, mode));
        e = file.fd ? 0 : errno;
    }
    fs::path path = directory / file.name;
    if (!e)
        e = disk::fchmod(file.fd.get(), mode) == 0 ? 0 : errno; // past the umask
    if (!e)
        e = STWFaultInjection::check(STWFaultPoint::Write);
    if (!e)
        e = STWWriteAll(file.fd.get(), contents);
    if (!e)
        e = syncDescriptor(file.fd.get(), path);
    if (e) {
        if (file.fd)
            disk::unlinkat(dirfd, file.name.c_str(), 0);
        STWSetError(error, STW_POSIX_ERROR(e, "Failed to write %@: %s", path, strerror(e)));
        return std::nullopt;
    }
    return file;
}

bool STWFileManager::replaceFileAt(int dirfd, TemporaryFile& file, const std::string& name, bool immutable,
                                   struct stat* identity, const fs::path& path, STWErrorRef* error) const {
    // The old file must lose its flag for the rename to replace it; it gets it back should
    // the rename fail.
    STWFileDescriptor old;
    bool unflagged = false;
    if (immutable) {
        old.reset(openat(dirfd, name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
        unflagged = old && isUserImmutable(old.get()) && setUserImmutable(old.get(), false) == 0;
    }
    int e = disk::renameat(dirfd, file.name.c_str(), dirfd, name.c_str()) == 0 ? 0 : errno;
    if (e) {
        disk::unlinkat(dirfd, file.name.c_str(), 0);
        if (unflagged)
            setUserImmutable(old.get(), true);
        STWSetError(error, STW_POSIX_ERROR(e, "rename of %@ to %@ failed: %s", fs::path(path).replace_filename(file.name),
                                           path, strerror(e)));
        return false;
    }
    struct stat st;
    if (fstat(file.fd.get(), &st) != 0) {
        e = errno;
        STWSetError(error, STW_POSIX_ERROR(e, "Failed to stat %@: %s", path, strerror(e)));
        return false;
    }
    // The rename has replaced the file: a failed sync of the directory only leaves it to the
    // next power cut to bring back the old one, whole. Failing here would leave the caller
    // believing the old file is still in place, without its flag and with a stale identity,
    // while the new one is what every reader sees.
    e = syncDescriptor(dirfd, parentPath(path));
    if (e)
        STW_LOG_ERROR(STWLogCategory::FS, "Failed to sync the directory of %@: %s", path, strerror(e));
    if (immutable) {
        // The flag guards against removal where the file system has it; ownership alone
        // still tells the daemon's files from others' where it does not.
        int flagError = setUserImmutable(file.fd.get(), true);
        if (flagError && !flagsUnsupported(flagError))
            STW_LOG_ERROR(STWLogCategory::FS, "Failed to make %@ immutable: %s", path, strerror(flagError));
    }
    if (identity)
        *identity = st;
    return true;
}

bool STWFileManager::setUserImmutableOfItemAtURL(const fs::path& url, bool immutable, STWErrorRef* error) const {
    STWFileDescriptor fd(open(url.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    int e = !fd ? errno : setUserImmutable(fd.get(), immutable);
    if (e && !flagsUnsupported(e)) {
        STWSetError(error, STW_POSIX_ERROR(e, "Failed to %s the immutable flag of %@: %s", immutable ? "set" : "clear",
                                           url, strerror(e)));
        return false;
    }
    return true;
}

namespace {

// The deepest directory of `url` that only root can change, "/" at least. A link of root's
// in such a directory counts when its whole target does (checked on the resolved path, which
// holds no link, so one level of recursion).
fs::path trustedAncestorOf(const fs::path& url, int depth = 0) {
    fs::path trusted = "/";
    uid_t root = geteuid();
    for (const auto& component : url.lexically_normal().relative_path()) {
        if (component.empty())
            continue;
        fs::path next = trusted / component;
        struct stat st;
        if (lstat(next.c_str(), &st) != 0 || st.st_uid != root)
            break;
        if (S_ISLNK(st.st_mode)) {
            char* real = depth == 0 ? realpath(next.c_str(), nullptr) : nullptr;
            bool qualifies = real && trustedAncestorOf(real, depth + 1) == fs::path(real);
            free(real);
            if (!qualifies)
                break;
        } else if (!S_ISDIR(st.st_mode) || ((st.st_mode & (S_IWGRP | S_IWOTH)) && !(st.st_mode & S_ISVTX))) {
            break;
        }
        trusted = next;
    }
    return trusted;
}

} // namespace

STWFileDescriptor STWFileManager::openDirectoryAtURLWithoutForeignLinks(const fs::path& url,
                                                                        STWErrorRef* error) const {
    fs::path path(pathString(url));
    fs::path ancestor = trustedAncestorOf(path);
    if (ancestor != path)
        return openDirectoryAtURL(path, ancestor, error);
    // Only root can change any part of it: opened as its path says, root's links and all.
    STWFileDescriptor fd(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!fd) {
        int e = errno;
        STWSetError(error, STW_POSIX_ERROR(e, "opendir of %@ failed: %s", path, strerror(e)));
    }
    return fd;
}

bool STWFileManager::moveItemAtURLWithoutForeignLinks(const fs::path& from, const fs::path& to,
                                                      STWFileManagerMoveOptions options, STWErrorRef* error) const {
    fs::path destination(pathString(to));
    STWFileDescriptor toParent = openDirectoryAtURLWithoutForeignLinks(destination.parent_path(), error);
    return toParent && moveItemAtURLWithoutForeignLinks(from, toParent.get(), destination.filename(), destination,
                                                        options, error);
}

bool STWFileManager::moveItemAtURLWithoutForeignLinks(const fs::path& from, int tofd, const std::string& toName,
                                                      const fs::path& to, STWFileManagerMoveOptions options,
                                                      STWErrorRef* error) const {
    fs::path source(pathString(from)), destination(pathString(to));
    STWFileDescriptor fromParent = openDirectoryAtURLWithoutForeignLinks(source.parent_path(), error);
    if (!fromParent)
        return false;
    std::string name = source.filename();
    struct stat st;
    STWFileDescriptor item;
    if (fstatat(fromParent.get(), name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0) {
        // Only files and directories are opened for reading (the durable move syncs them);
        // anything else, a FIFO or a link, is held without being opened.
        int flags = S_ISDIR(st.st_mode) || S_ISREG(st.st_mode) ? O_RDONLY | O_NONBLOCK | O_NOCTTY : O_PATH;
        item.reset(openat(fromParent.get(), name.c_str(), flags | O_NOFOLLOW | O_CLOEXEC));
    }
    if (!item) {
        int e = errno;
        STWSetError(error, STW_POSIX_ERROR(e, "Could not open %@ to move it to %@: %s", source, destination,
                                           strerror(e)));
        return false;
    }
    return moveDirectoryAt(fromParent.get(), name, tofd, toName, item.get(), options, source, destination, error);
}

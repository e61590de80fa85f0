// Removal of whole trees: links removed, never followed; immutable items unflagged first.
#include "Daemon/FileSystem/STWFileManager.h"

#include "Daemon/FileSystem/STWDirectoryWalker.h"
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

namespace {

// The per-item error handling of a tree removal: the first errno met is kept, and a
// user-immutable item is unflagged and unlinked instead of failing the removal.
class RemovalContext : public STWDirectoryWalker::Delegate {
public:
    int recordedError = 0;

    void itemFailed(int dirfd, const std::string& directoryPath, const std::string& name, int e) {
        std::string path = joinPath(directoryPath, name);
        // Every container's metadata file is immutable: EPERM is the common case, and only
        // an item that will not go even then is worth a line in the log.
        if (e == EPERM && _removeImmutableItem(dirfd, name, path))
            return;
        if (e != ENOENT)
            STW_LOG_ERROR(STWLogCategory::FS, "removefile hit error for %s : %s", path, strerror(e));
        if (recordedError == 0)
            recordedError = e;
    }

    bool visitEntry(int dirfd, const std::string& directoryPath, const STWDirectoryWalker::Entry& entry) override {
        if (entry.type == DT_DIR)
            return true;
        // The entry type spares a stat: unlinking a directory answers EISDIR.
        if (disk::unlinkat(dirfd, entry.name.c_str(), 0) == 0)
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
            if (disk::unlinkat(dirfd, name.c_str(), 0) == 0)
                return;
            e = errno;
        } else if (e != ENOENT && disk::unlinkat(dirfd, name.c_str(), AT_REMOVEDIR) == 0) {
            return; // an empty directory we may not read can still go
        }
        itemFailed(dirfd, directoryPath, name, e);
    }
    void leaveDirectory(int dirfd, const std::string& directoryPath, const std::string& name, int) override {
        if (disk::unlinkat(dirfd, name.c_str(), AT_REMOVEDIR) != 0)
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
        if (!fd || fstat(fd.get(), &opened) != 0 || !sameItem(opened, st))
            return false;
        if (!isUserImmutable(fd.get()))
            return false;
        if (int e = setUserImmutable(fd.get(), false)) {
            STW_LOG_ERROR(STWLogCategory::FS, "Failed to lchflags %s: %s", path, strerror(e));
            return false;
        }
        fd.reset();
        STW_LOG_DEBUG(STWLogCategory::FS, "Unset UF_IMMUTABLE on %s", path);
        if (disk::unlinkat(dirfd, name.c_str(), S_ISDIR(st.st_mode) ? AT_REMOVEDIR : 0) != 0) {
            STW_LOG_ERROR(STWLogCategory::FS, "unlink of %s failed: %s", path, strerror(errno));
            return false;
        }
        return true;
    }
};

// The recursive-remove routine for the entry `name` of `dirfd` (AT_FDCWD and a whole path
// for the path form), which `path` names: answers its own failure (ENOENT when nothing is
// there); failures of single items go to the context. A directory is opened without
// following a link; anything else fails that open and is unlinked as the entry it is, so
// the common case costs no stat.
int removeTree(int dirfd, const std::string& name, const std::string& path, RemovalContext& context) {
    std::string directoryPath = dirfd == AT_FDCWD ? std::string() : parentPath(path);
    STWFileDescriptor fd(openat(dirfd, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!fd) {
        int e = errno;
        if (e == ENOENT)
            return e;
        context.openFailed(dirfd, directoryPath, name, e);
        return 0;
    }
    STWDirectoryWalker().walk(fd.get(), path, context);
    fd.reset();
    if (disk::unlinkat(dirfd, name.c_str(), AT_REMOVEDIR) != 0)
        context.itemFailed(dirfd, directoryPath, name, errno);
    return 0;
}

// The result of removeTree as removeItemAtURL answers it.
bool removalResult(int e, const RemovalContext& context, const std::string& path, STWErrorRef* error) {
    if (!e || e == ENOENT)
        e = context.recordedError;
    if (!e || e == ENOENT) // gone already is removed
        return true;
    STWSetError(error, STW_POSIX_ERROR(e, "removefile of %@ failed: %s", path, strerror(e)));
    return false;
}

} // namespace

bool STWFileManager::removeItemAtURL(const fs::path& url, STWErrorRef* error) const {
    if (url.empty()) {
        STWSetError(error, STW_POSIX_ERROR(EFAULT, "nil url passed to -removeItemAtURL:error:"));
        return false;
    }
    std::string path = pathString(url);
    RemovalContext context;
    int e = removeTree(AT_FDCWD, path, path, context);
    return removalResult(e, context, path, error);
}

bool STWFileManager::removeItemAt(int dirfd, const std::string& name, const fs::path& path, STWErrorRef* error) const {
    std::string pathText = pathString(path);
    RemovalContext context;
    int e = removeTree(dirfd, name, pathText, context);
    return removalResult(e, context, pathText, error);
}

bool STWFileManager::removeDirectoryAt(int parentfd, const std::string& name, int directoryfd, const fs::path& path,
                                       STWErrorRef* error) const {
    std::string pathText = pathString(path);
    RemovalContext context;
    STWDirectoryWalker().walk(directoryfd, pathText, context);
    struct stat expected, current;
    int e = 0;
    if (fstat(directoryfd, &expected) != 0 || fstatat(parentfd, name.c_str(), &current, AT_SYMLINK_NOFOLLOW) != 0)
        e = errno;
    else if (!sameItem(current, expected))
        e = ESTALE; // moved away and replaced meanwhile: what is there now is not ours to remove
    else if (disk::unlinkat(parentfd, name.c_str(), AT_REMOVEDIR) != 0)
        context.itemFailed(parentfd, parentPath(path), name, errno);
    if (!e && context.recordedError != ENOENT)
        e = context.recordedError;
    if (e && e != ENOENT) { // gone already is removed
        STWSetError(error, STW_POSIX_ERROR(e, "removefile of %@ failed: %s", pathText, strerror(e)));
        return false;
    }
    return true;
}

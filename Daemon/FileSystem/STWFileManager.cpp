// The shared manager, home directories, and directories made by path.
#include "Daemon/FileSystem/STWFileManager.h"

#include "Daemon/FileSystem/STWFileSystemPrimitives.h"
#include "common/STWLog.h"
#include "platform/STWPlatformConfiguration.h"
#include "platform/STWUserDatabase.h"

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace fs = std::filesystem;
using namespace STWFileSystemPrimitives;

STWFileManager* STWFileManager::defaultManager() {
    static STWFileManager* manager = new STWFileManager;
    return manager;
}

namespace {

// The make-path routine: 0, EEXIST when the directory was there, or the errno.
int makePath(const std::string& path, mode_t mode) {
    if (disk::mkdirat(AT_FDCWD, path.c_str(), mode) == 0)
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
    if (disk::mkdirat(AT_FDCWD, path.c_str(), mode) == 0)
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
    } else if (disk::mkdirat(AT_FDCWD, path.c_str(), mode) != 0) {
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

std::optional<fs::path> STWFileManager::createTemporaryDirectoryInDirectoryURL(const fs::path& url,
                                                                               const std::string& withNamePrefix,
                                                                               STWErrorRef* error) const {
    STWSetError(error, nullptr);
    std::string templ = joinPath(pathString(url), STWFormat("%@XXXXXX", withNamePrefix));
    // mkdtemp() leaves its last attempt in the buffer when it fails; the error names the
    // template that was asked for.
    std::string path = templ;
    if (!disk::mkdtemp(path.data())) {
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

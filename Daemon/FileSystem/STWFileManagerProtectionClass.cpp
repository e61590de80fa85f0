// Data-protection classes of single items, read and set through a descriptor.
#include "Daemon/FileSystem/STWFileManager.h"

#include "Daemon/FileSystem/STWFileSystemPrimitives.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>

namespace fs = std::filesystem;
using namespace STWFileSystemPrimitives;

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

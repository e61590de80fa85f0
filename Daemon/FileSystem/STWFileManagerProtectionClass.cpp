// Data-protection classes of single items, read and set through a descriptor.
#include "Daemon/FileSystem/STWFileManager.h"

#include "Daemon/FileSystem/STWFileSystemPrimitives.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>

namespace fs = std::filesystem;
using namespace STWFileSystemPrimitives;

namespace {

// The item itself, never a link; O_NONBLOCK, so that a FIFO in a container cannot hang the
// daemon. Errors carry `function`, the operation that asked.
STWFileDescriptor openItem(const std::string& path, const char* function, STWErrorRef* error) {
    STWFileDescriptor fd(open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    if (!fd) {
        int e = errno;
        STWSetError(error, STWErrorCreate(STWPOSIXErrorDomain, e, function, __LINE__, nullptr, true,
                                          "Failed to open %s : %s", path, strerror(e)));
    }
    return fd;
}

} // namespace

bool STWFileManager::dataProtectionClassOfItemAtURL(const fs::path& url, int32_t* dataProtectionClass,
                                                    STWErrorRef* error) const {
    std::string path = pathString(url);
    STWFileDescriptor fd = openItem(path, __func__, error);
    if (!fd)
        return false;
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
    STWFileDescriptor fd = openItem(path, __func__, error);
    if (!fd)
        return false;
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

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

// Reads the class for `ifPredicate` and writes the new one through `fd`. `log` says whether
// a failure is logged here (a walk that meets many items logs for itself).
bool setClass(int fd, const std::string& path, int32_t toClass, const STWFileManager::ClassPredicate& ifPredicate,
              bool log, const char* function, STWErrorRef* error) {
    if (ifPredicate) {
        int32_t current = 0;
        if (int e = readProtectionClass(fd, &current)) {
            STWSetError(error, STWErrorCreate(STWPOSIXErrorDomain, e, function, __LINE__, nullptr, log,
                                              "Failed to getclass of file %s: %s", path, strerror(e)));
            return false;
        }
        if (!ifPredicate(current))
            return true;
    }
    if (int e = writeProtectionClass(fd, toClass)) {
        STWSetError(error, STWErrorCreate(STWPOSIXErrorDomain, e, function, __LINE__, nullptr, log,
                                          "Failed to setclass(%d) on file %s: %s", toClass, path, strerror(e)));
        return false;
    }
    return true;
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
    return fd && setClass(fd.get(), path, toClass, ifPredicate, true, __func__, error);
}

bool STWFileManager::setDataProtectionClassOfItemWithDescriptor(int fd, const std::string& path, int32_t toClass,
                                                                const ClassPredicate& ifPredicate,
                                                                STWErrorRef* error) const {
    return setClass(fd, path, toClass, ifPredicate, false, __func__, error);
}

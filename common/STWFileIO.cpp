#include "common/STWFileIO.h"

#include "common/STWFileDescriptor.h"
#include "common/STWSystemCall.h"

#include <cerrno>
#include <cstdlib>
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

int STWWriteAll(int fd, std::string_view contents) {
    const char* p = contents.data();
    size_t left = contents.size();
    while (left > 0) {
        ssize_t n = STWRetryOnEINTR([&] { return write(fd, p, left); });
        if (n < 0)
            return errno;
        p += n;
        left -= static_cast<size_t>(n);
    }
    return 0;
}

namespace {

int closeChecked(int fd) {
    return close(fd) == 0 || errno == EINTR ? 0 : errno;
}

} // namespace

int STWReadFileContents(const std::filesystem::path& path, std::string* contents, unsigned options,
                        size_t maxSize) {
    int flags = O_RDONLY | O_CLOEXEC | ((options & STWReadNoFollow) ? O_NOFOLLOW : 0);
    STWFileDescriptor fd(open(path.c_str(), flags));
    if (!fd)
        return errno;
    struct stat st;
    if (fstat(fd.get(), &st) != 0)
        return errno;
    if (!S_ISREG(st.st_mode))
        return S_ISDIR(st.st_mode) ? EISDIR : EINVAL;
    return STWReadDescriptorContents(fd.get(), static_cast<size_t>(st.st_size), contents, maxSize);
}

int STWReadDescriptorContents(int fd, size_t expectedSize, std::string* contents, size_t maxSize) {
    if (expectedSize > maxSize)
        return EFBIG;
    std::string data;
    data.resize(expectedSize);
    size_t used = 0;
    while (true) {
        if (used == data.size()) {
            // The file may have grown since fstat; keep reading up to the limit.
            if (data.size() >= maxSize) {
                char probe;
                if (read(fd, &probe, 1) > 0)
                    return EFBIG;
                break;
            }
            data.resize(std::min(maxSize, data.size() + 4096));
        }
        ssize_t n = STWRetryOnEINTR([&] { return read(fd, data.data() + used, data.size() - used); });
        if (n < 0)
            return errno;
        if (n == 0)
            break;
        used += static_cast<size_t>(n);
    }
    data.resize(used);
    *contents = std::move(data);
    return 0;
}

int STWWriteFile(const std::filesystem::path& path, std::string_view contents, mode_t mode, bool sync) {
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, mode);
    if (fd < 0)
        return errno;
    int e = STWWriteAll(fd, contents);
    if (!e && sync && fsync(fd) != 0)
        e = errno;
    int c = closeChecked(fd);
    return e ? e : c;
}

int STWWriteFileAtomically(const std::filesystem::path& path, std::string_view contents, mode_t mode,
                           bool syncDirectory) {
    std::filesystem::path directory = path.parent_path();
    if (directory.empty())
        directory = ".";
    std::string temp = (directory / ("." + path.filename().string() + ".XXXXXX")).string();
    int fd = mkostemp(temp.data(), O_CLOEXEC);
    if (fd < 0)
        return errno;
    int e = fchmod(fd, mode) == 0 ? 0 : errno;
    if (!e)
        e = STWWriteAll(fd, contents);
    if (!e && fsync(fd) != 0)
        e = errno;
    int c = closeChecked(fd);
    if (!e)
        e = c;
    if (!e && rename(temp.c_str(), path.c_str()) != 0)
        e = errno;
    if (e) {
        unlink(temp.c_str());
        return e;
    }
    return syncDirectory ? STWSyncDirectory(directory) : 0;
}

int STWRemoveAbandonedAtomicWrites(const std::filesystem::path& directory) {
    DIR* listing = opendir(directory.c_str());
    if (!listing)
        return errno == ENOENT ? 0 : -errno;
    int removed = 0;
    while (dirent* entry = readdir(listing)) {
        // "." + the name it was to get + "." + mkostemp's six characters.
        std::string_view name = entry->d_name;
        if (name.size() < 9 || name[0] != '.' || name[name.size() - 7] != '.')
            continue;
        struct stat st;
        if (fstatat(dirfd(listing), entry->d_name, &st, AT_SYMLINK_NOFOLLOW) == 0 && S_ISREG(st.st_mode) &&
            unlinkat(dirfd(listing), entry->d_name, 0) == 0)
            ++removed;
    }
    closedir(listing);
    return removed;
}

int STWSyncDirectory(const std::filesystem::path& directory) {
    int fd = open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0)
        return errno;
    int e = fsync(fd) == 0 ? 0 : errno;
    close(fd);
    return e;
}

#include "Daemon/FileSystem/STWDirectoryWalker.h"

#include "common/STWSystemCall.h"

#include <cerrno>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

struct STWDirectoryWalker::Frame {
    int fd = -1; // -1 while parked
    bool ownsFd = true;
    dev_t device = 0; // identity recorded when parked, checked when reopened
    ino_t inode = 0;
    std::string path;
    std::string name; // name in the parent
    std::vector<std::string> subdirectories;
    size_t next = 0;
};

STWDirectoryWalker::STWDirectoryWalker(size_t openDirectoryLimit)
    : _openDirectoryLimit(openDirectoryLimit < 2 ? 2 : openDirectoryLimit),
      _buffer(std::make_unique_for_overwrite<char[]>(_bufferSize)) {}

int STWDirectoryWalker::_readEntries(int fd, std::vector<Entry>* entries) {
    // The whole directory is read before anything in it changes, so removing entries
    // never makes the read skip or repeat one.
    for (;;) {
        ssize_t n = STWRetryOnEINTR([&] { return getdents64(fd, _buffer.get(), _bufferSize); });
        if (n < 0)
            return errno;
        if (n == 0)
            return 0;
        for (ssize_t offset = 0; offset < n;) {
            dirent64 record;
            // The buffer holds packed records; copy the fixed part out to read it aligned.
            std::memcpy(&record, _buffer.get() + offset, offsetof(dirent64, d_name));
            const char* name = _buffer.get() + offset + offsetof(dirent64, d_name);
            offset += record.d_reclen;
            if (name[0] == '.' && (name[1] == 0 || (name[1] == '.' && name[2] == 0)))
                continue;
            entries->push_back(Entry{name, record.d_type});
        }
    }
}

void STWDirectoryWalker::_visit(Frame& frame, Delegate& delegate) {
    std::vector<Entry> entries;
    if (int e = _readEntries(frame.fd, &entries))
        delegate.readFailed(frame.path, e);
    for (Entry& entry : entries) {
        if (delegate.visitEntry(frame.fd, frame.path, entry))
            frame.subdirectories.push_back(std::move(entry.name));
    }
}

void STWDirectoryWalker::walk(int rootfd, const std::string& rootPath, Delegate& delegate) {
    std::vector<Frame> stack;
    stack.push_back(Frame{rootfd, false, 0, 0, rootPath, {}, {}, 0});
    _visit(stack.back(), delegate);
    // Frames 1 ..< parked have let go of their descriptors.
    size_t parked = 1;

    auto closeAll = [&] {
        for (Frame& frame : stack)
            if (frame.ownsFd && frame.fd >= 0)
                close(frame.fd);
        stack.clear();
    };

    while (!stack.empty()) {
        if (delegate.shouldStop())
            break;
        Frame& top = stack.back();
        if (top.next < top.subdirectories.size()) {
            std::string name = std::move(top.subdirectories[top.next++]);
            int fd = openat(top.fd, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
            if (fd < 0) {
                delegate.openFailed(top.fd, top.path, name, errno);
                continue;
            }
            if (!delegate.enterDirectory(top.fd, top.path, name, fd)) {
                close(fd);
                continue;
            }
            std::string path = top.path + "/" + name;
            if (stack.size() - parked >= _openDirectoryLimit) {
                Frame& oldest = stack[parked];
                struct stat st;
                if (fstat(oldest.fd, &st) != 0) {
                    int e = errno;
                    close(fd);
                    delegate.readFailed(oldest.path, e);
                    break;
                }
                oldest.device = st.st_dev;
                oldest.inode = st.st_ino;
                close(oldest.fd);
                oldest.fd = -1;
                ++parked;
            }
            stack.push_back(Frame{fd, true, 0, 0, std::move(path), std::move(name), {}, 0});
            _visit(stack.back(), delegate);
            continue;
        }
        if (stack.size() == 1)
            break; // the root is the caller's
        Frame done = std::move(stack.back());
        stack.pop_back();
        Frame& parent = stack.back();
        if (parent.fd < 0) {
            int fd = openat(done.fd, "..", O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
            struct stat st;
            bool same = fd >= 0 && fstat(fd, &st) == 0 && st.st_dev == parent.device && st.st_ino == parent.inode;
            if (!same) {
                // The directory was moved while we were below it: what is above us now
                // is not the tree we were asked to walk.
                if (fd >= 0)
                    close(fd);
                close(done.fd);
                delegate.readFailed(parent.path, EBUSY);
                break;
            }
            parent.fd = fd;
            --parked;
        }
        delegate.leaveDirectory(parent.fd, parent.path, done.name, done.fd);
        close(done.fd);
    }
    closeAll();
}

// Walks a directory tree through directory descriptors, for the whole-tree operations of
// STWFileManager (removal, copy, disk usage, durable sync).
//
// Every directory is opened relative to its parent with O_NOFOLLOW, so a symbolic link
// swapped in for a directory is never followed out of the tree. The walk keeps its state
// on the heap and holds a bounded number of descriptors however deep the tree is: when
// too many are open, the oldest ancestor is closed and later reopened through "..", and
// its identity checked, so a container that nests directories very deeply can neither
// overflow the daemon's stack nor exhaust its descriptors.
#pragma once

#include <cstddef>
#include <memory>
#include <string>
#include <sys/types.h>
#include <vector>

class STWDirectoryWalker {
public:
    struct Entry {
        std::string name;
        unsigned char type; // DT_* from the directory entry; DT_UNKNOWN when the file system has none
    };

    class Delegate {
    public:
        virtual ~Delegate() = default;
        // One entry of the directory open as `dirfd` (path `directoryPath`). Answer true
        // to descend into it; only directories can be descended into.
        virtual bool visitEntry(int dirfd, const std::string& directoryPath, const Entry& entry) = 0;
        // The subdirectory `name` of `dirfd` was opened as `fd`; answer false to skip it.
        virtual bool enterDirectory(int dirfd, const std::string& directoryPath, const std::string& name, int fd) {
            (void)dirfd, (void)directoryPath, (void)name, (void)fd;
            return true;
        }
        // All of `name`'s contents have been visited. `fd` is still open.
        virtual void leaveDirectory(int dirfd, const std::string& directoryPath, const std::string& name, int fd) = 0;
        // The subdirectory `name` could not be opened.
        virtual void openFailed(int dirfd, const std::string& directoryPath, const std::string& name, int error) = 0;
        // Reading the directory at `path` failed, or (EBUSY) the directory was moved while
        // the walk had let go of it; in that case the walk ends.
        virtual void readFailed(const std::string& path, int error) = 0;
        // Polled between directories; true ends the walk.
        virtual bool shouldStop() const { return false; }
    };

    // Directories held open at once, besides the root.
    static constexpr size_t defaultOpenDirectoryLimit = 128;

    explicit STWDirectoryWalker(size_t openDirectoryLimit = defaultOpenDirectoryLimit);

    // Walks the contents of the directory open as `rootfd`, which is read from its current
    // offset and left open; the root itself is not reported.
    void walk(int rootfd, const std::string& rootPath, Delegate& delegate);

private:
    struct Frame;
    int _readEntries(int fd, std::vector<Entry>* entries);
    void _visit(Frame& frame, Delegate& delegate);

    size_t _openDirectoryLimit;
    // For getdents64; left uninitialized, as a walker is made for every tree removed.
    static constexpr size_t _bufferSize = 64 * 1024;
    std::unique_ptr<char[]> _buffer;
};

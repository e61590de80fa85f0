// The small system-call helpers that the sources of STWFileManager share: path pieces,
// durability (with the test observer of every sync), protection-class attributes,
// the user-immutable inode flag, owner and class of a directory through its descriptor,
// and trace intervals. Internal to the file layer; everyone else goes through
// STWFileManager.
#pragma once

#include "common/STWError.h"

#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <string_view>
#include <sys/types.h>
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

} // namespace STWFileSystemPrimitives

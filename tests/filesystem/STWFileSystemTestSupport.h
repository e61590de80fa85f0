// Scratch trees, privilege dropping, immutable flags and tmpfs mounts for the file-layer
// tests. Everything lives under the process's private test root.
#pragma once

#include "Daemon/FileSystem/STWFileManager.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <functional>
#include <string>
#include <sys/acl.h>
#include <sys/stat.h>
#include <sys/types.h>

namespace stwtest {

inline constexpr uid_t kNobody = 65534;

// A fresh directory per test under ROOT/private/var/tests, removed afterwards (immutable
// flags included). The log is quieted: rejections are what these tests provoke.
class FileSystemTest : public ::testing::Test {
protected:
    void SetUp() override;
    void TearDown() override;

    STWFileManager* fm() const { return STWFileManager::defaultManager(); }
    const std::filesystem::path& scratch() const { return _scratch; }

private:
    std::filesystem::path _scratch;
};

void writeFile(const std::filesystem::path& path, const std::string& contents, mode_t mode = 0644);
std::string readFile(const std::filesystem::path& path);
struct stat lstatOf(const std::filesystem::path& path);
// An ACL as short text with numeric ids ("error: ..." where it cannot be read), and its setter.
std::string aclText(const std::filesystem::path& path, acl_type_t type);
void setACLText(const std::filesystem::path& path, const char* text, acl_type_t type = ACL_TYPE_ACCESS);

// Runs `body` in a forked child with the given ids and no supplementary groups; answers
// the body's result, or 100 + n when dropping privileges or the child itself failed.
int runAs(uid_t uid, gid_t gid, const std::function<int()>& body);

// Sets or clears FS_IMMUTABLE_FL; false where the file system or our privileges do not allow it.
bool setImmutable(const std::filesystem::path& path, bool immutable);

// Clears the immutable flag everywhere below `path` so that the tree can be cleaned up.
void clearImmutableFlags(const std::filesystem::path& path);

// A tmpfs mounted on a new directory, unmounted and removed at the end of the scope.
class ScopedTmpfs {
public:
    explicit ScopedTmpfs(const std::filesystem::path& mountPoint);
    ~ScopedTmpfs();
    bool mounted() const { return _mounted; }
    const std::string& failure() const { return _failure; }

private:
    std::filesystem::path _mountPoint;
    bool _mounted = false;
    std::string _failure;
};

} // namespace stwtest

#include "tests/filesystem/STWFileSystemTestSupport.h"

#include "common/STWFileIO.h"
#include "common/STWLog.h"
#include "tests/support/STWTestRoot.h"

#include <acl/libacl.h>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <grp.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/wait.h>
#include <unistd.h>

namespace fs = std::filesystem;

namespace stwtest {

void FileSystemTest::SetUp() {
    STWLog::setSystemLogLevel(STWLogLevel::Fault);
    fs::path parent = STWTestRoot::shared().resolve("/private/var/tests");
    fs::create_directories(parent);
    std::string templ = (parent / "t.XXXXXX").native();
    ASSERT_NE(mkdtemp(templ.data()), nullptr) << strerror(errno);
    _scratch = templ;
    // Unprivileged children must be able to reach into it.
    fs::permissions(_scratch, fs::perms(0755));
}

void FileSystemTest::TearDown() {
    clearImmutableFlags(_scratch);
    std::error_code ec;
    fs::remove_all(_scratch, ec);
    STWLog::setSystemLogLevel(STWLogLevel::Info);
}

void writeFile(const fs::path& path, const std::string& contents, mode_t mode) {
    ASSERT_EQ(STWWriteFile(path, contents, mode, false), 0) << path;
    ASSERT_EQ(chmod(path.c_str(), mode), 0);
}

std::string readFile(const fs::path& path) {
    std::string contents;
    EXPECT_EQ(STWReadFileContents(path, &contents), 0) << path;
    return contents;
}

struct stat lstatOf(const fs::path& path) {
    struct stat st = {};
    EXPECT_EQ(lstat(path.c_str(), &st), 0) << path;
    return st;
}

std::string aclText(const fs::path& path, acl_type_t type) {
    acl_t acl = acl_get_file(path.c_str(), type);
    if (!acl)
        return std::string("error: ") + strerror(errno);
    char* text = acl_to_any_text(acl, nullptr, ',', TEXT_ABBREVIATE | TEXT_NUMERIC_IDS);
    std::string result = text ? text : "";
    acl_free(text);
    acl_free(acl);
    return result;
}

void setACLText(const fs::path& path, const char* text, acl_type_t type) {
    acl_t acl = acl_from_text(text);
    ASSERT_NE(acl, nullptr) << text;
    int result = acl_set_file(path.c_str(), type, acl);
    int error = errno;
    acl_free(acl);
    ASSERT_EQ(result, 0) << path << ": " << strerror(error);
}

int runAs(uid_t uid, gid_t gid, const std::function<int()>& body) {
    pid_t pid = fork();
    if (pid < 0)
        return 101;
    if (pid == 0) {
        if (setgroups(0, nullptr) != 0 || setresgid(gid, gid, gid) != 0 || setresuid(uid, uid, uid) != 0)
            _exit(100);
        _exit(body());
    }
    int status = 0;
    if (waitpid(pid, &status, 0) != pid)
        return 102;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 103;
}

bool setImmutable(const fs::path& path, bool immutable) {
    int fd = open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
    if (fd < 0)
        return false;
    int flags = 0;
    bool ok = ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0;
    if (ok) {
        flags = immutable ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
        ok = ioctl(fd, FS_IOC_SETFLAGS, &flags) == 0;
    }
    close(fd);
    return ok;
}

void clearImmutableFlags(const fs::path& path) {
    std::error_code ec;
    if (!fs::exists(fs::symlink_status(path, ec)))
        return;
    setImmutable(path, false);
    if (!fs::is_directory(fs::symlink_status(path, ec)))
        return;
    fs::permissions(path, fs::perms::owner_all, fs::perm_options::add, ec);
    for (auto it = fs::recursive_directory_iterator(path, fs::directory_options::skip_permission_denied, ec);
         !ec && it != fs::recursive_directory_iterator(); it.increment(ec)) {
        if (it->is_symlink(ec))
            continue;
        setImmutable(it->path(), false);
        if (it->is_directory(ec))
            fs::permissions(it->path(), fs::perms::owner_all, fs::perm_options::add, ec);
    }
}

ScopedTmpfs::ScopedTmpfs(const fs::path& mountPoint) : _mountPoint(mountPoint) {
    std::error_code ec;
    fs::create_directories(_mountPoint, ec);
    if (mount("stowly-test", _mountPoint.c_str(), "tmpfs", MS_NOSUID | MS_NODEV, "size=64m,mode=0755") == 0)
        _mounted = true;
    else
        _failure = strerror(errno);
}

ScopedTmpfs::~ScopedTmpfs() {
    if (_mounted)
        umount2(_mountPoint.c_str(), MNT_DETACH);
    std::error_code ec;
    fs::remove(_mountPoint, ec);
}

} // namespace stwtest

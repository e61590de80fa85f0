// ACLs and ownership of container trees: the system-container ACL walk and the ownership
// walk of ordinary containers.
//
// What the group "systemusers" is given, as POSIX.1e ACLs:
//   every item below a container directory
//       user::---  group::---  other::---  group:systemusers:rwx  mask::rwx
//     and, on a directory, the same as its default ACL, so that what is made below later
//     inherits it;
//   the container directory itself
//       its own user::, group:: and other:: entries, group:systemusers:-wx (create and name
//       items, nothing more) and the mask they need, with the default ACL above, so that
//       full rights reach everything below it and only it.
// The kernel shows an ACL's mask as the group bits of the mode: an item "with mode 000"
// reads 0070 in stat, its owner and other bits empty and its owning group's entry empty.
// For the same reason a mode is always changed before the ACL is written, never after.
//
// Apps own these trees. Every item is opened from its parent's descriptor without
// following a link (regular files O_RDONLY|O_NONBLOCK, so that a FIFO swapped in cannot
// block us; other kinds O_PATH) and changed through that descriptor; what O_PATH cannot
// change directly goes through /proc/self/fd, which names the very inode we hold. Links
// carry neither mode nor ACL on Linux and are only re-owned. A non-directory with several
// hard links is changed only once all of its links were met in the tree: otherwise a link
// planted here would hand us an inode that lives somewhere else.
#include "Daemon/FileSystem/STWFileManager.h"

#include "Daemon/FileSystem/STWDirectoryWalker.h"
#include "Daemon/FileSystem/STWFileSystemPrimitives.h"
#include "common/STWLog.h"
#include "platform/STWUserDatabase.h"

#include <acl/libacl.h>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <map>
#include <sys/acl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <utility>

namespace fs = std::filesystem;
using namespace STWFileSystemPrimitives;

namespace {

constexpr const char* kSystemUsersGroup = "systemusers";
constexpr acl_perm_t kFullAccess = ACL_READ | ACL_WRITE | ACL_EXECUTE;
// Adding and naming entries of a directory: write and search.
constexpr acl_perm_t kTopLevelAccess = ACL_WRITE | ACL_EXECUTE;

bool leftAlone(std::string_view name) {
    return name.find(STWContainerMetadataFileName) != std::string_view::npos;
}

STWErrorRef aclError(const char* format, int e) {
    return STW_ERROR(STWErrorSetACLFailed, nullptr, format, strerror(e));
}

// An acl_t that is freed when it goes out of scope.
class ACL {
public:
    ACL() = default;
    explicit ACL(acl_t acl) : _acl(acl) {}
    ACL(const ACL&) = delete;
    ACL& operator=(const ACL&) = delete;
    ACL(ACL&& other) noexcept : _acl(std::exchange(other._acl, nullptr)) {}
    ~ACL() {
        if (_acl)
            acl_free(_acl);
    }
    acl_t get() const { return _acl; }
    acl_t* address() { return &_acl; }
    explicit operator bool() const { return _acl != nullptr; }

private:
    acl_t _acl = nullptr;
};

// Appends one entry `tag` (with `qualifier` for a named group) granting `permissions`.
bool appendEntry(acl_t* acl, acl_tag_t tag, const gid_t* qualifier, acl_perm_t permissions,
                 STWErrorRef* error) {
    acl_entry_t entry;
    if (acl_create_entry(acl, &entry) != 0) {
        STWSetError(error, aclError("acl_create_entry() failed: %s", errno));
        return false;
    }
    acl_permset_t permset;
    if (acl_get_permset(entry, &permset) != 0) {
        STWSetError(error, aclError("acl_get_permset() failed: %s", errno));
        return false;
    }
    acl_clear_perms(permset);
    for (acl_perm_t bit : {ACL_READ, ACL_WRITE, ACL_EXECUTE}) {
        if ((permissions & bit) && acl_add_perm(permset, bit) != 0) {
            int e = errno;
            STWSetError(error,
                        STW_ERROR(STWErrorSetACLFailed, nullptr, "acl_add_perm() failed to set perms %x: %s",
                                  permissions, strerror(e)));
            return false;
        }
    }
    if (acl_set_permset(entry, permset) != 0) {
        STWSetError(error, aclError("acl_set_permset() failed: %s", errno));
        return false;
    }
    if (acl_set_tag_type(entry, tag) != 0) {
        STWSetError(error, aclError("acl_set_tag_type() failed: %s", errno));
        return false;
    }
    if (qualifier && acl_set_qualifier(entry, qualifier) != 0) {
        STWSetError(error, aclError("acl_set_qualifier() failed: %s", errno));
        return false;
    }
    return true;
}

bool finish(acl_t* acl, STWErrorRef* error) {
    if (acl_calc_mask(acl) != 0) {
        STWSetError(error, aclError("acl_calc_mask() failed: %s", errno));
        return false;
    }
    return true;
}

std::optional<gid_t> systemUsersGroup(STWErrorRef* error) {
    auto gid = STWUserDatabase::groupIDWithName(kSystemUsersGroup);
    if (!gid)
        STWSetError(error,
                    STW_ERROR(STWErrorSetACLFailed, nullptr,
                              "The group \"%s\" is missing from the group database", kSystemUsersGroup));
    return gid;
}

// The ACL of every item below a container directory, also the default ACL of directories;
// `group` gets the id of "systemusers" it names.
ACL copySystemContainerItemACL(gid_t* group, STWErrorRef* error) {
    auto found = systemUsersGroup(error);
    if (!found)
        return {};
    *group = *found;
    ACL acl(acl_init(5));
    if (!acl) {
        STWSetError(error, aclError("acl_init() failed: %s", errno));
        return {};
    }
    if (!appendEntry(acl.address(), ACL_USER_OBJ, nullptr, 0, error) ||
        !appendEntry(acl.address(), ACL_GROUP_OBJ, nullptr, 0, error) ||
        !appendEntry(acl.address(), ACL_OTHER, nullptr, 0, error) ||
        !appendEntry(acl.address(), ACL_GROUP, group, kFullAccess, error) || !finish(acl.address(), error))
        return {};
    return acl;
}

// The container directory's own ACL: its owner, owning group and other entries as they
// are, any named entries replaced by the group's.
ACL copyTopLevelSystemContainerACL(int fd, gid_t group, STWErrorRef* error) {
    ACL acl(acl_get_fd(fd));
    if (!acl) {
        STWSetError(error, aclError("acl_get_fd() failed: %s", errno));
        return {};
    }
    acl_entry_t entry;
    for (int which = ACL_FIRST_ENTRY; acl_get_entry(acl.get(), which, &entry) == 1; which = ACL_NEXT_ENTRY) {
        acl_tag_t tag;
        if (acl_get_tag_type(entry, &tag) == 0 && (tag == ACL_USER || tag == ACL_GROUP || tag == ACL_MASK) &&
            acl_delete_entry(acl.get(), entry) != 0) {
            STWSetError(error, aclError("acl_delete_entry() failed: %s", errno));
            return {};
        }
    }
    if (!appendEntry(acl.address(), ACL_GROUP, &group, kTopLevelAccess, error) ||
        !finish(acl.address(), error))
        return {};
    return acl;
}

// One item of the tree, open as `fd`: a real descriptor, or with `pathOnly` an O_PATH one.
struct Item {
    STWFileDescriptor fd;
    bool pathOnly = false;
    struct stat st {};
};

// Opens `name` of `dirfd` itself, never what a link there leads to, and never waiting for a
// FIFO's other end. false (errno set) when it is gone or cannot be opened.
bool openItem(int dirfd, const char* name, unsigned char type, Item* item) {
    bool mayOpen = type == DT_REG || type == DT_DIR || type == DT_UNKNOWN;
    if (mayOpen) {
        item->fd.reset(openat(dirfd, name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
        item->pathOnly = false;
    }
    // A link (listed as one, or swapped in since) or another kind of item.
    if (!item->fd && (!mayOpen || errno == ELOOP || errno == ENXIO)) {
        item->fd.reset(openat(dirfd, name, O_PATH | O_NOFOLLOW | O_CLOEXEC));
        item->pathOnly = true;
    }
    return item->fd && fstat(item->fd.get(), &item->st) == 0;
}

int changeOwner(const Item& item, uid_t uid, gid_t gid) {
    int r = item.pathOnly ? disk::fchownat(item.fd.get(), "", uid, gid, AT_EMPTY_PATH | AT_SYMLINK_NOFOLLOW)
                          : disk::fchown(item.fd.get(), uid, gid);
    return r == 0 ? 0 : errno;
}

// Links have no mode of their own on Linux: nothing to do for them.
int changeMode(const Item& item, mode_t mode) {
    if (S_ISLNK(item.st.st_mode))
        return 0;
    int r = item.pathOnly ? disk::fchmodat(AT_FDCWD, procfsPath(item.fd.get()).c_str(), mode, 0)
                          : disk::fchmod(item.fd.get(), mode);
    return r == 0 ? 0 : errno;
}

int setACL(const Item& item, acl_t acl, acl_type_t type) {
    if (disk::injected(STWFaultPoint::SetAttribute))
        return errno;
    // libacl writes a default ACL only by path.
    int r = !item.pathOnly && type == ACL_TYPE_ACCESS
                ? acl_set_fd(item.fd.get(), acl)
                : acl_set_file(procfsPath(item.fd.get()).c_str(), type, acl);
    return r == 0 ? 0 : errno;
}

// The part both walks share: which items to visit and to change, and where.
class TreeWalk : public STWDirectoryWalker::Delegate {
public:
    // Changes the item at `path`.
    virtual void change(const Item& item, const std::string& path) = 0;

    bool visitEntry(int dirfd, const std::string& directoryPath,
                    const STWDirectoryWalker::Entry& entry) override {
        if (leftAlone(entry.name))
            return false;
        if (entry.type == DT_DIR)
            return true; // changed by enterDirectory() through the descriptor the walk opens
        Item item;
        if (!openItem(dirfd, entry.name.c_str(), entry.type, &item)) {
            if (errno != ENOENT)
                STW_LOG_ERROR(STWLogCategory::FS, "Could not open %s: %s",
                              joinPath(directoryPath, entry.name), strerror(errno));
            return false;
        }
        if (S_ISDIR(item.st.st_mode))
            return item.st.st_dev == device; // a directory that the listing could not tell
        std::string path = joinPath(directoryPath, entry.name);
        if (item.st.st_nlink > 1 && !_allLinksMet(item.st, path))
            return false;
        change(item, path);
        return false;
    }
    bool enterDirectory(int, const std::string& directoryPath, const std::string& name, int fd) override {
        Item item;
        item.fd.reset(fd);
        bool same = fstat(fd, &item.st) == 0 && item.st.st_dev == device;
        if (same)
            change(item, joinPath(directoryPath, name));
        item.fd.release(); // the walker's
        return same;
    }
    void leaveDirectory(int, const std::string&, const std::string&, int) override {}
    void openFailed(int, const std::string& directoryPath, const std::string& name, int e) override {
        // A directory replaced by a link or removed since it was listed.
        if (e != ENOENT)
            STW_LOG_ERROR(STWLogCategory::FS, "Could not open %s: %s", joinPath(directoryPath, name),
                          strerror(e));
    }
    void readFailed(const std::string& path, int e) override {
        STW_LOG_ERROR(STWLogCategory::FS, "Could not read %s: %s", path, strerror(e));
        if (!readError)
            readError = e;
    }

    // Logs the items that kept a link outside the tree.
    void reportUnchanged() const {
        for (const auto& [inode, links] : _links)
            STW_LOG_NOTICE(STWLogCategory::FS, "Left %s alone: %llu of its %llu links lie outside %s",
                           links.path, static_cast<unsigned long long>(links.count - links.seen),
                           static_cast<unsigned long long>(links.count), root);
    }

    dev_t device = 0;
    std::string root;
    int readError = 0;

private:
    // Counts the links of an inode met so far; true at its last one, which is when the
    // inode is known to lie wholly inside the tree.
    bool _allLinksMet(const struct stat& st, const std::string& path) {
        auto [it, inserted] = _links.try_emplace({st.st_dev, st.st_ino}, Links{0, st.st_nlink, path});
        (void)inserted;
        if (++it->second.seen < st.st_nlink)
            return false;
        _links.erase(it);
        return true;
    }
    struct Links {
        nlink_t seen;
        nlink_t count;
        std::string path;
    };
    std::map<std::pair<dev_t, ino_t>, Links> _links;
};

class ACLWalk : public TreeWalk {
public:
    acl_t itemACL = nullptr;
    uid_t uid = 0;
    gid_t gid = 0;

    void change(const Item& item, const std::string& path) override {
        // Mode before ACL: on Linux the ACL's mask is the mode's group bits.
        if (int e = changeMode(item, 0))
            STW_LOG_ERROR(STWLogCategory::FS, "Could not chmod %s: %s", path, strerror(e));
        if (int e = changeOwner(item, uid, gid))
            STW_LOG_ERROR(STWLogCategory::FS, "Could not chown %s: %s", path, strerror(e));
        if (S_ISLNK(item.st.st_mode))
            return;
        int e = setACL(item, itemACL, ACL_TYPE_ACCESS);
        if (!e && S_ISDIR(item.st.st_mode))
            e = setACL(item, itemACL, ACL_TYPE_DEFAULT);
        if (e)
            STW_LOG_ERROR(STWLogCategory::FS, "Failed to set ACL on dir %s: %s", path, strerror(e));
    }
};

class OwnershipWalk : public TreeWalk {
public:
    uid_t uid = 0;
    gid_t gid = 0;

    void change(const Item& item, const std::string& path) override {
        // Owner before mode: chown clears the set-id bits.
        if (item.st.st_uid != uid || item.st.st_gid != gid)
            if (int e = changeOwner(item, uid, gid))
                STW_LOG_ERROR(STWLogCategory::FS, "Could not chown %s: %s", path, strerror(e));
        mode_t mode = S_ISDIR(item.st.st_mode) || (item.st.st_mode & 0111) ? 0755 : 0644;
        if ((item.st.st_mode & 07777) != mode)
            if (int e = changeMode(item, mode))
                STW_LOG_ERROR(STWLogCategory::FS, "Could not chmod %s: %s", path, strerror(e));
    }
};

// Opens the root of a walk without following a link: a directory to walk, or (for staged
// content) a single item.
bool openRoot(const std::string& path, Item* item, STWErrorRef* error) {
    if (!openItem(AT_FDCWD, path.c_str(), DT_UNKNOWN, item)) {
        int e = errno;
        STWSetError(error, STW_POSIX_ERROR(e, "Could not open %s: %s", path, strerror(e)));
        return false;
    }
    return true;
}

// Walks below the directory open as `rootfd`; false with a POSIX error when a directory
// could not be read.
bool walkBelow(int rootfd, const std::string& path, TreeWalk& walk, STWErrorRef* error) {
    // A descriptor of our own: the walk reads the directory from its start.
    STWFileDescriptor fd(openat(rootfd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    struct stat st;
    if (!fd || fstat(fd.get(), &st) != 0) {
        int e = errno;
        STWSetError(error, STW_POSIX_ERROR(e, "Could not open %s: %s", path, strerror(e)));
        return false;
    }
    walk.device = st.st_dev;
    walk.root = path;
    STWDirectoryWalker().walk(fd.get(), path, walk);
    walk.reportUnchanged();
    if (walk.readError) {
        STWSetError(error,
                    STW_POSIX_ERROR(walk.readError, "Error for path %s: %s", path, strerror(walk.readError)));
        return false;
    }
    return true;
}

bool setTopLevelACL(const Item& root, gid_t group, acl_t itemACL, const std::string& path,
                    STWErrorRef* error) {
    ACL acl = copyTopLevelSystemContainerACL(root.fd.get(), group, error);
    if (!acl)
        return false;
    int e = setACL(root, acl.get(), ACL_TYPE_ACCESS);
    if (!e)
        e = setACL(root, itemACL, ACL_TYPE_DEFAULT);
    if (e) {
        STWSetError(error, STW_ERROR(STWErrorSetACLFailed, nullptr, "Failed to set ACL on %@: %s", path,
                                     strerror(e)));
        return false;
    }
    return true;
}

} // namespace

bool STWFileManager::setTopLevelSystemContainerACLAtURL(const fs::path& url, STWErrorRef* error) const {
    std::string path = pathString(url);
    STWFileDescriptor fd(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!fd) {
        int e = errno;
        STWSetError(error, STW_ERROR(STWErrorSetACLFailed, nullptr, "Failed to set ACL on %@: %s", path,
                                     strerror(e)));
        return false;
    }
    return setTopLevelSystemContainerACLAt(fd.get(), url, error);
}

bool STWFileManager::setTopLevelSystemContainerACLAt(int rootfd, const fs::path& url,
                                                     STWErrorRef* error) const {
    std::string path = pathString(url);
    gid_t group;
    ACL itemACL = copySystemContainerItemACL(&group, error);
    if (!itemACL)
        return false;
    Item root;
    root.fd.reset(rootfd);
    bool ok = setTopLevelACL(root, group, itemACL.get(), path, error);
    root.fd.release(); // the caller's
    return ok;
}

bool STWFileManager::standardizeACLsAtURL(const fs::path& url, bool isSystemContainer,
                                          STWErrorRef* error) const {
    std::string path = pathString(url);
    Item root;
    if (!openRoot(path, &root, error))
        return false;
    return standardizeACLsAt(root.fd.get(), url, isSystemContainer, error);
}

bool STWFileManager::standardizeACLsAt(int rootfd, const fs::path& url, bool isSystemContainer,
                                       STWErrorRef* error) const {
    std::string path = pathString(url);
    TraceInterval trace("StandardizingACLs", path);
    gid_t group;
    ACL itemACL = copySystemContainerItemACL(&group, error);
    if (!itemACL)
        return false;
    if (leftAlone(path)) {
        trace.end(path, 0);
        return true;
    }
    ACLWalk walk;
    walk.itemACL = itemACL.get();
    walk.uid = STWUserDatabase::nobodyUID();
    walk.gid = STWUserDatabase::nobodyGID();
    Item root;
    root.fd.reset(rootfd);
    if (fstat(rootfd, &root.st) != 0) {
        int e = errno;
        root.fd.release();
        STWSetError(error, STW_POSIX_ERROR(e, "Could not stat %s: %s", path, strerror(e)));
        trace.end(path, 0);
        return false;
    }
    bool isDirectory = S_ISDIR(root.st.st_mode);
    if (isSystemContainer && !isDirectory) {
        root.fd.release();
        STWSetError(error, STW_POSIX_ERROR(ENOTDIR, "Could not open %s: %s", path, strerror(ENOTDIR)));
        trace.end(path, 0);
        return false;
    }
    if (isSystemContainer) {
        STWErrorRef rootError;
        if (!setTopLevelACL(root, group, walk.itemACL, path, &rootError))
            STW_LOG_ERROR(STWLogCategory::FS, "Failed to set top level ACL on dir %s: %s", path,
                          rootError ? rootError->description() : std::string());
    } else {
        walk.change(root, path);
    }
    root.fd.release(); // the caller's
    // Staged content may be a single item, with nothing below it.
    bool ok = !isDirectory || walkBelow(rootfd, path, walk, error);
    trace.end(path, 0);
    return ok;
}

bool STWFileManager::standardizeACLsForSystemContainerAtURL(const fs::path& url, STWErrorRef* error) const {
    return standardizeACLsAtURL(url, true, error);
}

bool STWFileManager::standardizeAllSystemContainerACLsAtURL(const fs::path& url, STWErrorRef* error) const {
    std::string path = pathString(url);
    STWErrorRef listError;
    auto items = urlsForItemsInDirectoryAtURL(url, &listError);
    if (!items) {
        if (listError && listError->isPOSIX(ENOENT))
            return true;
        STW_LOG_ERROR(STWLogCategory::FS, "Failed to get items at URL%@ : %@", path, listError);
        STWSetError(error, std::move(listError));
        return false;
    }
    if (items->empty())
        return true;
    std::string listing = "(";
    for (const fs::path& item : *items)
        listing += (listing.size() > 1 ? ", " : "") + item.native();
    listing += ")";
    STW_LOG_NOTICE(STWLogCategory::FS, "Potential containers requiring ACL migration: %@", listing);
    bool ok = true;
    for (const fs::path& container : *items) {
        STWErrorRef containerError;
        if (!standardizeACLsForSystemContainerAtURL(container, &containerError)) {
            STW_LOG_ERROR(STWLogCategory::FS, "Failed to set system container ACL at %@: %@", container,
                          containerError);
            ok = false;
            if (error && !*error)
                *error = std::move(containerError);
        }
    }
    return ok;
}

bool STWFileManager::standardizeOwnershipAtURL(const fs::path& url, uid_t uid, gid_t gid,
                                               STWErrorRef* error) const {
    std::string path = pathString(url);
    Item root;
    if (!openRoot(path, &root, error))
        return false;
    if (S_ISDIR(root.st.st_mode))
        return standardizeOwnershipAt(root.fd.get(), url, uid, gid, error);
    if (!leftAlone(path)) {
        OwnershipWalk walk;
        walk.uid = uid;
        walk.gid = gid;
        walk.change(root, path);
    }
    return true;
}

bool STWFileManager::standardizeOwnershipAt(int rootfd, const fs::path& url, uid_t uid, gid_t gid,
                                            STWErrorRef* error) const {
    std::string path = pathString(url);
    TraceInterval trace("StandardizingOwnership", path);
    OwnershipWalk walk;
    walk.uid = uid;
    walk.gid = gid;
    bool ok = walkBelow(rootfd, path, walk, error);
    // The root last, as it is after the walk.
    Item root;
    root.fd.reset(rootfd);
    if (fstat(rootfd, &root.st) != 0) {
        int e = errno;
        STWSetError(error, STW_POSIX_ERROR(e, "Could not stat %s: %s", path, strerror(e)));
        ok = false;
    } else if (!leftAlone(path)) {
        walk.change(root, path);
    }
    root.fd.release(); // the caller's
    trace.end(path, 0);
    return ok;
}

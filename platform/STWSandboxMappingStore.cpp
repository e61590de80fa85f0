#include "platform/STWSandboxMappingStore.h"

#include "common/STWFormat.h"
#include "platform/STWPlatformConfiguration.h"

#include <atomic>
#include <cerrno>
#include <climits>
#include <cstring>
#include <fcntl.h>
#include <openssl/sha.h>
#include <mutex>
#include <sys/stat.h>
#include <unistd.h>

namespace {

std::mutex sharedMutex;
std::shared_ptr<STWSandboxMappingStore> shared;

constexpr int directoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

// Opens the directory `name` inside `parent`, creating it first when asked; answers as
// openat() does. A symbolic link in its place fails (ELOOP, or ENOTDIR for a link to a
// file) instead of being followed.
int openChildDirectory(int parent, const std::string& name, bool create) {
    int fd = openat(parent, name.c_str(), directoryFlags);
    if (fd >= 0 || errno != ENOENT || !create)
        return fd;
    bool created = mkdirat(parent, name.c_str(), 0755) == 0;
    if (!created && errno != EEXIST)
        return -1;
    fd = openat(parent, name.c_str(), directoryFlags);
    // Readers of the store are not root; the umask must not hide the tree from them.
    if (fd >= 0 && created)
        fchmod(fd, 0755);
    return fd;
}

std::string directoryKey(const STWSandboxMappingItem& item) {
    std::string key = std::to_string(item.uid);
    key += '/';
    key += std::to_string(item.kernelPersonaID);
    key += '/';
    key += std::to_string(item.itemType);
    return key;
}

bool inSameDirectory(const STWSandboxMappingItem& a, const STWSandboxMappingItem& b) {
    return a.uid == b.uid && a.kernelPersonaID == b.kernelPersonaID && a.itemType == b.itemType;
}

} // namespace

class STWFileSandboxMappingStore::Directory {
public:
    explicit Directory(int fd) : _fd(fd) {}
    ~Directory() {
        if (_fd >= 0)
            close(_fd);
    }
    Directory(const Directory&) = delete;
    Directory& operator=(const Directory&) = delete;
    int fd() const { return _fd; }

private:
    int _fd;
};

std::string STWSandboxMappingItem::description() const {
    return STWFormat("<mapping uid %u, persona %u, itemType %llu, identifier %@>", uid, kernelPersonaID,
                     static_cast<unsigned long long>(itemType), identifier);
}

std::shared_ptr<STWSandboxMappingStore> STWSandboxMappingStore::sharedInstance() {
    std::lock_guard guard(sharedMutex);
    if (!shared)
        shared = std::make_shared<STWFileSandboxMappingStore>(
            STWPlatformConfiguration::sharedInstance()->runtimeDirectory() / "sandbox");
    return shared;
}

void STWSandboxMappingStore::setSharedInstance(std::shared_ptr<STWSandboxMappingStore> store) {
    std::lock_guard guard(sharedMutex);
    shared = std::move(store);
}

std::vector<bool> STWSandboxMappingStore::userStateItemsAre(const std::vector<ItemAndPath>& items) {
    std::vector<bool> current(items.size());
    for (size_t i = 0; i < items.size(); ++i) {
        auto path = userStateItem(items[i].first);
        current[i] = path && path->native() == items[i].second;
    }
    return current;
}

std::string STWSandboxMappingStore::nameForIdentifier(std::string_view identifier) {
    bool plain = !identifier.empty() && identifier.size() <= NAME_MAX && identifier.front() != '.' &&
                 identifier.front() != '%' && identifier.find('/') == std::string_view::npos &&
                 identifier.find('\0') == std::string_view::npos;
    if (plain)
        return std::string(identifier);
    unsigned char digest[SHA256_DIGEST_LENGTH];
    SHA256(reinterpret_cast<const unsigned char*>(identifier.data()), identifier.size(), digest);
    std::string name = "%";
    name += STWHexString(digest, sizeof digest);
    return name;
}

STWFileSandboxMappingStore::STWFileSandboxMappingStore(std::filesystem::path baseDirectory)
    : _baseDirectory(std::move(baseDirectory)),
      _temporaryPrefix(STWFormat(".stowly-tmp-%d-", static_cast<int>(getpid()))) {}

// A name for a link before it is renamed into place. Unique within the process; a collision
// with a stray entry (or a forked child's) is retried with the next number.
std::string STWFileSandboxMappingStore::_temporaryName() {
    static std::atomic<uint64_t> counter{0};
    return _temporaryPrefix + std::to_string(counter.fetch_add(1));
}

// Walks from the base to the item's ITEMTYPE directory.
int STWFileSandboxMappingStore::_openItemDirectory(const STWSandboxMappingItem& item, bool create,
                                                   STWErrorRef* error) {
    // Readers pass no error: a missing directory is their usual answer, not worth a message.
    const char* function = __func__;
    auto fail = [&](int e, uint64_t line) {
        if (error)
            *error = STWErrorCreate(STWPOSIXErrorDomain, e, function, line, nullptr, false,
                                    "Cannot open the directory of %@ in %@: %s", item, _baseDirectory,
                                    strerror(e));
        return -1;
    };
    // The base directory is ours (from the configuration), so its parents may be links;
    // only the store's own tree is walked without following them.
    if (create) {
        std::error_code ec;
        std::filesystem::create_directories(_baseDirectory.parent_path(), ec);
    }
    Directory parent(open(_baseDirectory.parent_path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (parent.fd() < 0)
        return fail(errno, __LINE__);
    int current = openChildDirectory(parent.fd(), _baseDirectory.filename().string(), create);
    if (current < 0)
        return fail(errno, __LINE__);

    const std::string components[] = {STWFormat("%u", item.uid), STWFormat("%u", item.kernelPersonaID),
                                      STWFormat("%llu", static_cast<unsigned long long>(item.itemType))};
    for (const std::string& component : components) {
        int next = openChildDirectory(current, component, create);
        int e = errno;
        close(current);
        if (next < 0)
            return fail(e, __LINE__);
        current = next;
    }
    return current;
}

STWFileSandboxMappingStore::DirectoryRef
STWFileSandboxMappingStore::_itemDirectory(const STWSandboxMappingItem& item, bool create,
                                           STWErrorRef* error) {
    std::string key = directoryKey(item);
    STWLockGuard guard(_directoriesLock);
    if (auto it = _directoriesLock_directories.find(key); it != _directoriesLock_directories.end())
        return it->second;
    int fd = _openItemDirectory(item, create, error);
    if (fd < 0)
        return nullptr;
    auto directory = std::make_shared<const Directory>(fd);
    _directoriesLock_directories.emplace(std::move(key), directory);
    return directory;
}

void STWFileSandboxMappingStore::_forgetItemDirectory(const STWSandboxMappingItem& item,
                                                      const DirectoryRef& directory) {
    STWLockGuard guard(_directoriesLock);
    auto it = _directoriesLock_directories.find(directoryKey(item));
    if (it != _directoriesLock_directories.end() && it->second == directory)
        _directoriesLock_directories.erase(it);
}

bool STWFileSandboxMappingStore::setUserStateItem(const STWSandboxMappingItem& item,
                                                  const std::optional<std::filesystem::path>& path,
                                                  STWErrorRef* error) {
    if (path && (path->empty() || path->native().find('\0') != std::string::npos)) {
        STWSetError(error, STW_POSIX_ERROR_NOLOG(EINVAL, "Cannot map %@ to the path %@", item, *path));
        return false;
    }
    STWErrorRef directoryError;
    DirectoryRef directory = _itemDirectory(item, path.has_value(), &directoryError);
    if (!directory) {
        // Nothing to withdraw when the directories are not there.
        if (!path && directoryError->isPOSIX(ENOENT))
            return true;
        STWSetError(error, directoryError);
        return false;
    }

    if (!path) {
        // In a directory removed since it was opened, the link is gone with it.
        if (unlinkat(directory->fd(), nameForIdentifier(item.identifier).c_str(), 0) == 0 || errno == ENOENT)
            return true;
        int e = errno;
        STWSetError(error, STW_POSIX_ERROR_NOLOG(e, "Cannot withdraw %@: %s", item, strerror(e)));
        return false;
    }

    // With no mapping there (the usual case: pushes withdraw first), the link is made under
    // its own name. A mapping that is there is replaced through a temporary name and a
    // rename, so that readers see the old path or the new one, never neither.
    const std::string target = nameForIdentifier(item.identifier);
    std::string name = target;
    for (int attempt = 0;; ++attempt) {
        if (symlinkat(path->c_str(), directory->fd(), name.c_str()) != 0) {
            int e = errno;
            if (e == ENOENT && attempt == 0) {
                // The kept directory has been removed: walk to the current one.
                _forgetItemDirectory(item, directory);
                if (!(directory = _itemDirectory(item, true, error)))
                    return false;
                continue;
            }
            if (e == EEXIST && attempt < 100) {
                name = _temporaryName();
                continue;
            }
            STWSetError(error,
                        STW_POSIX_ERROR_NOLOG(e, "Cannot link %@ to %@: %s", item, *path, strerror(e)));
            return false;
        }
        if (name == target)
            return true;
        if (renameat(directory->fd(), name.c_str(), directory->fd(), target.c_str()) != 0) {
            int e = errno;
            unlinkat(directory->fd(), name.c_str(), 0);
            STWSetError(error,
                        STW_POSIX_ERROR_NOLOG(e, "Cannot replace the link of %@: %s", item, strerror(e)));
            return false;
        }
        return true;
    }
}

std::optional<std::filesystem::path> STWFileSandboxMappingStore::userStateItem(const STWSandboxMappingItem& item) {
    DirectoryRef directory = _itemDirectory(item, false, nullptr);
    if (!directory)
        return std::nullopt;
    char buffer[PATH_MAX];
    ssize_t length = readlinkat(directory->fd(), nameForIdentifier(item.identifier).c_str(), buffer, sizeof(buffer));
    if (length < 0 || static_cast<size_t>(length) >= sizeof(buffer))
        return std::nullopt;
    return std::filesystem::path(std::string(buffer, static_cast<size_t>(length)));
}

std::vector<bool> STWFileSandboxMappingStore::userStateItemsAre(const std::vector<ItemAndPath>& items) {
    std::vector<bool> current(items.size());
    // A batch is mostly one directory: look it up again only when the item's is another.
    const STWSandboxMappingItem* directoryItem = nullptr;
    DirectoryRef directory;
    char buffer[PATH_MAX];
    for (size_t i = 0; i < items.size(); ++i) {
        const auto& [item, path] = items[i];
        if (!directoryItem || !inSameDirectory(*directoryItem, item)) {
            directory = _itemDirectory(item, false, nullptr);
            directoryItem = &item;
        }
        if (!directory || path.size() >= PATH_MAX)
            continue;
        // One byte more than the path, so that a longer target is not taken for it.
        ssize_t length =
            readlinkat(directory->fd(), nameForIdentifier(item.identifier).c_str(), buffer, path.size() + 1);
        current[i] = length >= 0 && std::string_view(buffer, static_cast<size_t>(length)) == path;
    }
    return current;
}

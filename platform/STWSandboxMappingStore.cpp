#include "platform/STWSandboxMappingStore.h"

#include "common/STWFormat.h"
#include "platform/STWPlatformConfiguration.h"

#include <atomic>
#include <cerrno>
#include <climits>
#include <fcntl.h>
#include <mutex>
#include <sys/stat.h>
#include <unistd.h>

namespace {

std::mutex sharedMutex;
std::shared_ptr<STWSandboxMappingStore> shared;

class Descriptor {
public:
    explicit Descriptor(int fd = -1) : _fd(fd) {}
    ~Descriptor() {
        if (_fd >= 0)
            close(_fd);
    }
    Descriptor(const Descriptor&) = delete;
    Descriptor& operator=(const Descriptor&) = delete;
    int get() const { return _fd; }

private:
    int _fd;
};

constexpr int directoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

// Opens the directory `name` inside `parent`, creating it first when asked. A symbolic link
// in its place fails (ELOOP, or ENOTDIR for a link to a file) instead of being followed.
int openChildDirectory(int parent, const std::string& name, bool create) {
    int fd = openat(parent, name.c_str(), directoryFlags);
    if (fd >= 0 || errno != ENOENT || !create)
        return fd >= 0 ? fd : -errno;
    bool created = mkdirat(parent, name.c_str(), 0755) == 0;
    if (!created && errno != EEXIST)
        return -errno;
    fd = openat(parent, name.c_str(), directoryFlags);
    if (fd < 0)
        return -errno;
    // Readers of the store are not root; the umask must not hide the tree from them.
    if (created)
        fchmod(fd, 0755);
    return fd;
}

std::string personaDirectoryName(const STWSandboxMappingItem& item) {
    return item.personaUniqueString ? *item.personaUniqueString
                                    : std::string(STWSandboxMappingStore::noPersonaDirectoryName);
}

// A name for the link before it is renamed into place. Unique within the process; a
// collision with a stray entry is retried with the next number.
std::string temporaryName() {
    static std::atomic<uint64_t> counter{0};
    return STWFormat(".stowly-tmp-%d-%llu", static_cast<int>(getpid()),
                     static_cast<unsigned long long>(counter.fetch_add(1)));
}

} // namespace

std::string STWSandboxMappingItem::description() const {
    return STWFormat("<mapping uid %u, persona %@ (%u), itemType %llu, identifier %@>", uid,
                     personaUniqueString ? *personaUniqueString : std::string("(null)"), kernelPersonaID,
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

bool STWSandboxMappingStore::isSafePathComponent(std::string_view name) {
    if (name.empty() || name == "." || name == "..")
        return false;
    return name.find('/') == std::string_view::npos && name.find('\0') == std::string_view::npos;
}

STWFileSandboxMappingStore::STWFileSandboxMappingStore(std::filesystem::path baseDirectory)
    : _baseDirectory(std::move(baseDirectory)) {}

int STWFileSandboxMappingStore::_openItemDirectory(const STWSandboxMappingItem& item, bool create) {
    if (!isSafePathComponent(item.identifier))
        return -EINVAL;
    if (item.personaUniqueString &&
        (!isSafePathComponent(*item.personaUniqueString) || *item.personaUniqueString == noPersonaDirectoryName))
        return -EINVAL;

    // The base directory is ours (from the configuration), so its parents may be links;
    // only the store's own tree is walked without following them.
    if (create) {
        std::error_code ec;
        std::filesystem::create_directories(_baseDirectory.parent_path(), ec);
    }
    Descriptor parent(open(_baseDirectory.parent_path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (parent.get() < 0)
        return -errno;
    int current = openChildDirectory(parent.get(), _baseDirectory.filename().string(), create);
    if (current < 0)
        return current;

    const std::string components[] = {STWFormat("%u", item.uid), personaDirectoryName(item),
                                      STWFormat("%llu", static_cast<unsigned long long>(item.itemType))};
    for (const std::string& component : components) {
        int next = openChildDirectory(current, component, create);
        close(current);
        if (next < 0)
            return next;
        current = next;
    }
    return current;
}

int STWFileSandboxMappingStore::setUserStateItem(const STWSandboxMappingItem& item,
                                                 const std::optional<std::filesystem::path>& path) {
    if (path && (path->empty() || path->native().find('\0') != std::string::npos))
        return EINVAL;
    int fd = _openItemDirectory(item, path.has_value());
    if (fd < 0) {
        // Nothing to withdraw when the directories are not there.
        if (!path && fd == -ENOENT)
            return 0;
        return -fd;
    }
    Descriptor directory(fd);

    if (!path) {
        if (unlinkat(directory.get(), item.identifier.c_str(), 0) == 0 || errno == ENOENT)
            return 0;
        return errno;
    }

    std::string temporary;
    for (int attempt = 0;; ++attempt) {
        temporary = temporaryName();
        if (symlinkat(path->c_str(), directory.get(), temporary.c_str()) == 0)
            break;
        if (errno != EEXIST || attempt == 100)
            return errno;
    }
    if (renameat(directory.get(), temporary.c_str(), directory.get(), item.identifier.c_str()) != 0) {
        int e = errno;
        unlinkat(directory.get(), temporary.c_str(), 0);
        return e;
    }
    return 0;
}

std::optional<std::filesystem::path> STWFileSandboxMappingStore::userStateItem(const STWSandboxMappingItem& item) {
    int fd = _openItemDirectory(item, false);
    if (fd < 0)
        return std::nullopt;
    Descriptor directory(fd);
    char buffer[PATH_MAX];
    ssize_t length = readlinkat(directory.get(), item.identifier.c_str(), buffer, sizeof(buffer));
    if (length < 0 || static_cast<size_t>(length) >= sizeof(buffer))
        return std::nullopt;
    return std::filesystem::path(std::string(buffer, static_cast<size_t>(length)));
}

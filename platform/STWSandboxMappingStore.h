// The sandbox's per-user state store of container mappings: for each (user, persona, item
// type, identifier) the path of one container, so that whoever enforces the sandbox can
// resolve a container without asking the daemon. The container cache is the only writer.
//
// On Linux the store is a tree of symbolic links below the runtime directory:
//
//     ROOT/run/stowly/sandbox/UID/PERSONA/ITEMTYPE/NAME -> container path
//
// UID, PERSONA and ITEMTYPE are decimal numbers: PERSONA is the user identity's kernel
// persona id (an identity built without persona data gives its POSIX user id), so one
// container has the same item at every start. NAME is the identifier itself when that is
// a plain file name (not empty, no "/" or NUL, at most 255 bytes, not beginning with "."
// or "%"); any other identifier, the empty one included, is stored under "%" and the
// SHA-256 of the identifier in hex, which no plain name can equal and which never climbs
// out of its directory. nameForIdentifier() gives the name, for readers of the store.
//
// A mapping is set by creating the link NAME; one that is there already is replaced by
// creating the link under a temporary name in the same directory and renaming it over
// NAME, so a reader sees the old path or the new one, never neither. A mapping is
// withdrawn by removing the link. The store's directories are opened one component at a
// time without following symbolic links, so a link planted in the tree can never redirect
// a write outside it.
//
// A rebuild pushes one mapping per container, so the store keeps each ITEMTYPE directory
// open once it has found it: a push is then a few calls on that descriptor rather than a
// walk from the base. A directory removed behind the store's back (someone clearing the
// runtime directory) is noticed when a link cannot be made in it, and is opened afresh.
// Only root can write the tree, so nobody else can swap a kept directory for another.
// After a restart most of what a rebuild pushes is there already, so a rebuild first asks
// which of a batch of items already map to their paths (userStateItemsAre) and pushes only
// the others: one read of each link, in a directory found once per batch.
//
// STWSandboxMappingStore is the interface; sharedInstance() is the Linux store of the
// configured root prefix unless a test installed another with setSharedInstance().
//
// Failures are POSIX-domain errors carrying the errno of the failing call; the store does
// not log them, its caller (the container cache) does, with the mapping it was pushing.
#pragma once

#include "common/STWError.h"
#include "common/STWThreadSafety.h"

#include <cstdint>
#include <filesystem>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <sys/types.h>
#include <unordered_map>
#include <utility>
#include <vector>

// Which item of the store: the fields the sandbox keys its user state by.
struct STWSandboxMappingItem {
    uid_t uid = 0;
    // The kernel's persona id of the identity (its POSIX user id when it has no persona).
    uint32_t kernelPersonaID = 0;
    uint64_t itemType = 0;
    std::string identifier;

    std::string description() const;
};

class STWSandboxMappingStore {
public:
    virtual ~STWSandboxMappingStore() = default;

    static std::shared_ptr<STWSandboxMappingStore> sharedInstance();
    static void setSharedInstance(std::shared_ptr<STWSandboxMappingStore> store);

    // Sets the item to `path`, or withdraws it when `path` is nullopt (withdrawing an item
    // that is not there succeeds).
    virtual bool setUserStateItem(const STWSandboxMappingItem& item,
                                  const std::optional<std::filesystem::path>& path, STWErrorRef* error) = 0;

    // The path the item maps to, or nullopt when there is none (or it cannot be read).
    virtual std::optional<std::filesystem::path> userStateItem(const STWSandboxMappingItem& item) = 0;
    // For each item, whether it maps to exactly the path given with it, in order: what a
    // rebuild asks of every container it finds, a batch at a time.
    using ItemAndPath = std::pair<STWSandboxMappingItem, std::string_view>;
    virtual std::vector<bool> userStateItemsAre(const std::vector<ItemAndPath>& items);

    // The file name under which the identifier's link is stored.
    static std::string nameForIdentifier(std::string_view identifier);
};

// The Linux store: symbolic links below `baseDirectory` (ROOT/run/stowly/sandbox for the
// shared instance).
class STWFileSandboxMappingStore : public STWSandboxMappingStore {
public:
    explicit STWFileSandboxMappingStore(std::filesystem::path baseDirectory);

    const std::filesystem::path& baseDirectory() const { return _baseDirectory; }

    bool setUserStateItem(const STWSandboxMappingItem& item, const std::optional<std::filesystem::path>& path,
                          STWErrorRef* error) override;
    std::optional<std::filesystem::path> userStateItem(const STWSandboxMappingItem& item) override;
    std::vector<bool> userStateItemsAre(const std::vector<ItemAndPath>& items) override;

private:
    class Directory;
    using DirectoryRef = std::shared_ptr<const Directory>;

    // The ITEMTYPE directory of the item: a kept one, or one opened (creating what is
    // missing with mode 0755 when `create`) refusing symbolic links on the way, then kept.
    DirectoryRef _itemDirectory(const STWSandboxMappingItem& item, bool create, STWErrorRef* error);
    // Stops keeping `directory` for the item (unless another has replaced it already).
    void _forgetItemDirectory(const STWSandboxMappingItem& item, const DirectoryRef& directory);
    // The walk from the base: the descriptor, or -1 with `error` (when given) set.
    int _openItemDirectory(const STWSandboxMappingItem& item, bool create, STWErrorRef* error);
    std::string _temporaryName();

    const std::filesystem::path _baseDirectory;
    const std::string _temporaryPrefix;
    STWMutex _directoriesLock;
    // "UID/PERSONA/ITEMTYPE" to its open directory.
    std::unordered_map<std::string, DirectoryRef> _directoriesLock_directories STW_GUARDED_BY(_directoriesLock);
};

// Who a peer process is, as far as code signing goes: the stand-in for the platform's
// code-signing and entitlement queries.
//
// Every program allowed to speak to the daemon with an identity has a property list in
// ROOT/etc/stowly/clients.d/: "CodeSigningIdentifier", "Executable" (absolute path),
// optional "SHA256" (hex digest the executable must match), "Entitlements", optional
// "Sandboxed" and "Persona". A peer is matched by the executable its process runs; the
// directory is reloaded whenever it changes. In developer mode a connection may instead
// declare its identity in a hello frame (STWPeerConnection::declaredIdentity).
#pragma once

#include "common/STWThreadSafety.h"
#include "common/STWError.h"
#include "common/STWValue.h"

#include <filesystem>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <shared_mutex>
#include <string>
#include <string_view>
#include <sys/types.h>
#include <tuple>
#include <vector>

class STWPeerConnection;

struct STWClientRegistryEntry {
    std::string codeSigningIdentifier;
    std::filesystem::path executable;
    std::optional<std::string> sha256; // lower-case hex
    // As the file has it: anything but a dictionary is "malformed" to the caller.
    STWValue entitlements;
    bool sandboxed = false;
    std::optional<std::string> personaUniqueString;

    // Reads one registry file's dictionary; nullopt (with `reason`) when a required key is
    // missing or a key has the wrong type.
    static std::optional<STWClientRegistryEntry> fromDictionary(const STWValue::Dictionary& dictionary,
                                                                bool requireExecutable, std::string* reason);
};
using STWClientRegistryEntryRef = std::shared_ptr<const STWClientRegistryEntry>;

class STWClientRegistry {
public:
    // The registry of the configured root; loaded and watched on first use.
    static STWClientRegistry& sharedInstance();

    explicit STWClientRegistry(std::filesystem::path directory);
    ~STWClientRegistry();

    // The entry of the program the peer runs (or its declared identity), or nullptr with
    // `error` describing why there is none.
    STWClientRegistryEntryRef entryForPeer(const STWPeerConnection& peer, STWErrorRef* error);
    // The entry for an executable opened as `executableFD`, whose path is `path`.
    STWClientRegistryEntryRef entryForExecutable(const std::filesystem::path& path, int executableFD,
                                                 STWErrorRef* error);
    // The executables registered under a code-signing identifier (an application's bundle
    // identifier); several programs may share one. Empty when none is.
    std::vector<std::filesystem::path> executablesForCodeSigningIdentifier(std::string_view identifier);

    // Rereads the directory. Bad files are logged and skipped.
    void reload();
    // Starts following changes of the directory with inotify.
    void watch();

    const std::filesystem::path& directory() const { return _directory; }

private:
    std::optional<std::string> _digestOfExecutable(int fd, STWErrorRef* error);

    const std::filesystem::path _directory;
    STWSharedMutex _lock;
    std::map<std::filesystem::path, STWClientRegistryEntryRef> _lock_entriesByExecutable STW_GUARDED_BY(_lock);
    int _watchToken = -1;

    // Digests are costly; an executable keeps its digest while its inode, size and
    // modification time stay the same.
    using DigestKey = std::tuple<dev_t, ino_t, off_t, int64_t, int64_t>;
    STWMutex _digestLock;
    std::map<DigestKey, std::string> _digestLock_digests STW_GUARDED_BY(_digestLock);
};

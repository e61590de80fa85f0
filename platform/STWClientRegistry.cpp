#include "platform/STWClientRegistry.h"

#include "common/STWFileDescriptor.h"
#include "common/STWSystemCall.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWLog.h"
#include "platform/STWFileWatcher.h"
#include "platform/STWPeerConnection.h"
#include "platform/STWPlatformConfiguration.h"

#include <cerrno>
#include <climits>
#include <cstring>
#include <fcntl.h>
#include <openssl/evp.h>
#include <sys/stat.h>
#include <unistd.h>

namespace {

bool isLowerHexDigest(const std::string& text) {
    if (text.size() != 64)
        return false;
    for (char c : text)
        if (!((c >= '0' && c <= '9') || (c >= 'a' && c <= 'f')))
            return false;
    return true;
}

} // namespace

std::optional<STWClientRegistryEntry>
STWClientRegistryEntry::fromDictionary(const STWValue::Dictionary& dictionary, bool requireExecutable,
                                       std::string* reason) {
    STWClientRegistryEntry entry;
    const std::string* identifier = STWDictionaryString(dictionary, "CodeSigningIdentifier");
    if (!identifier || identifier->empty()) {
        *reason = "CodeSigningIdentifier must be a non-empty string";
        return std::nullopt;
    }
    entry.codeSigningIdentifier = *identifier;

    if (const STWValue* v = STWDictionaryFind(dictionary, "Executable")) {
        if (!v->string() || !std::filesystem::path(*v->string()).is_absolute()) {
            *reason = "Executable must be an absolute path";
            return std::nullopt;
        }
        entry.executable = std::filesystem::path(*v->string()).lexically_normal();
    } else if (requireExecutable) {
        *reason = "Executable is missing";
        return std::nullopt;
    }
    if (const STWValue* v = STWDictionaryFind(dictionary, "SHA256")) {
        std::string digest = v->string() ? *v->string() : std::string();
        for (char& c : digest)
            c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
        if (!isLowerHexDigest(digest)) {
            *reason = "SHA256 must be 64 hexadecimal digits";
            return std::nullopt;
        }
        entry.sha256 = digest;
    }
    if (const STWValue* v = STWDictionaryFind(dictionary, "Entitlements"))
        entry.entitlements = *v;
    if (const STWValue* v = STWDictionaryFind(dictionary, "Sandboxed")) {
        if (!v->boolValue()) {
            *reason = "Sandboxed must be a boolean";
            return std::nullopt;
        }
        entry.sandboxed = *v->boolValue();
    }
    for (const char* key : {"Persona", "PersonaUniqueString"}) {
        if (const STWValue* v = STWDictionaryFind(dictionary, key)) {
            if (!v->string()) {
                *reason = std::string(key) + " must be a string";
                return std::nullopt;
            }
            entry.personaUniqueString = *v->string();
        }
    }
    return entry;
}

STWClientRegistry& STWClientRegistry::sharedInstance() {
    static STWClientRegistry* registry = [] {
        auto* r = new STWClientRegistry(
            STWPlatformConfiguration::sharedInstance()->configurationDirectory() / "clients.d");
        r->reload();
        r->watch();
        return r;
    }();
    return *registry;
}

STWClientRegistry::STWClientRegistry(std::filesystem::path directory) : _directory(std::move(directory)) {}

STWClientRegistry::~STWClientRegistry() {
    if (_watchToken >= 0)
        STWFileWatcher::sharedInstance().removeWatch(_watchToken);
}

void STWClientRegistry::reload() {
    std::map<std::filesystem::path, STWClientRegistryEntryRef> entries;
    std::error_code ec;
    for (std::filesystem::directory_iterator it(_directory, ec), end; !ec && it != end; it.increment(ec)) {
        const std::filesystem::path& file = it->path();
        if (file.extension() != ".plist")
            continue;
        STWErrorRef error;
        auto dictionary = STW_dictionaryWithContentsOfURL(file, STWReadNoFollow, &error);
        std::string reason;
        std::optional<STWClientRegistryEntry> entry;
        if (dictionary)
            entry = STWClientRegistryEntry::fromDictionary(*dictionary, true, &reason);
        else
            reason = error ? error->message() : "unreadable";
        if (!entry) {
            STW_LOG_ERROR(STWLogCategory::Tolvan, "Ignoring client registry file %@: %@", file, reason);
            continue;
        }
        auto executable = entry->executable;
        if (entries.count(executable))
            STW_LOG_ERROR(STWLogCategory::Tolvan, "Client registry file %@ names %@ again; the later file wins",
                          file, executable);
        entries[executable] = std::make_shared<const STWClientRegistryEntry>(std::move(*entry));
    }
    if (ec && ec != std::errc::no_such_file_or_directory)
        STW_LOG_ERROR(STWLogCategory::Tolvan, "Cannot read client registry %@: %s", _directory, ec.message());
    STW_LOG_INFO(STWLogCategory::Tolvan, "Client registry %@ holds %llu programs", _directory,
                 static_cast<uint64_t>(entries.size()));
    STWLockGuard guard(_lock);
    _lock_entriesByExecutable = std::move(entries);
}

void STWClientRegistry::watch() {
    std::error_code ec;
    std::filesystem::create_directories(_directory, ec);
    _watchToken = STWFileWatcher::sharedInstance().addWatch(_directory, [this](const std::string&) { reload(); });
    if (_watchToken < 0)
        STW_LOG_ERROR(STWLogCategory::Tolvan, "Cannot watch client registry %@: %s", _directory, strerror(errno));
}

STWClientRegistryEntryRef STWClientRegistry::entryForPeer(const STWPeerConnection& peer, STWErrorRef* error) {
    if (const STWClientRegistryEntryRef& declared = peer.declaredIdentity())
        return declared;

    // The executable is opened through /proc while the pidfd pins the process: if the
    // process died and its pid was reused in between, the pidfd says so afterwards.
    std::string procExe = "/proc/" + std::to_string(peer.pid()) + "/exe";
    char target[PATH_MAX];
    ssize_t length = readlink(procExe.c_str(), target, sizeof target - 1);
    STWFileDescriptor fd(length >= 0 ? open(procExe.c_str(), O_RDONLY | O_CLOEXEC) : -1);
    if (length < 0 || !fd) {
        STWSetError(error, STW_POSIX_ERROR_NOLOG(errno, "Cannot read the executable of pid %d", peer.pid()));
        return nullptr;
    }
    target[length] = '\0';
    if (!peer.isAlive()) {
        STWSetError(error, STW_POSIX_ERROR_NOLOG(ESRCH, "Process %d exited", peer.pid()));
        return nullptr;
    }
    return entryForExecutable(target, fd.get(), error);
}

STWClientRegistryEntryRef STWClientRegistry::entryForExecutable(const std::filesystem::path& path,
                                                                int executableFD, STWErrorRef* error) {
    STWClientRegistryEntryRef entry;
    {
        STWSharedLockGuard guard(_lock);
        auto it = _lock_entriesByExecutable.find(path.lexically_normal());
        if (it != _lock_entriesByExecutable.end())
            entry = it->second;
    }
    if (!entry) {
        STWSetError(error, STW_POSIX_ERROR_NOLOG(ENOENT, "No signing identifier for %@", path));
        return nullptr;
    }
    if (entry->sha256) {
        auto digest = _digestOfExecutable(executableFD, error);
        if (!digest)
            return nullptr;
        if (*digest != *entry->sha256) {
            STWSetError(error, STW_POSIX_ERROR_NOLOG(EPERM, "The digest of %@ does not match its registry entry",
                                                     path));
            return nullptr;
        }
    }
    return entry;
}

std::vector<std::filesystem::path>
STWClientRegistry::executablesForCodeSigningIdentifier(std::string_view identifier) {
    std::vector<std::filesystem::path> executables;
    STWSharedLockGuard guard(_lock);
    for (const auto& [executable, entry] : _lock_entriesByExecutable)
        if (entry->codeSigningIdentifier == identifier)
            executables.push_back(executable);
    return executables;
}

std::optional<std::string> STWClientRegistry::_digestOfExecutable(int fd, STWErrorRef* error) {
    struct stat st;
    if (fstat(fd, &st) != 0) {
        STWSetError(error, STW_POSIX_ERROR_NOLOG(errno, "Cannot stat an executable"));
        return std::nullopt;
    }
    DigestKey key{st.st_dev, st.st_ino, st.st_size, st.st_mtim.tv_sec, st.st_mtim.tv_nsec};
    {
        STWLockGuard guard(_digestLock);
        auto it = _digestLock_digests.find(key);
        if (it != _digestLock_digests.end())
            return it->second;
    }

    std::unique_ptr<EVP_MD_CTX, decltype(&EVP_MD_CTX_free)> context(EVP_MD_CTX_new(), EVP_MD_CTX_free);
    if (!context || EVP_DigestInit_ex(context.get(), EVP_sha256(), nullptr) != 1) {
        STWSetError(error, STW_POSIX_ERROR_NOLOG(ENOMEM, "Cannot start a digest"));
        return std::nullopt;
    }
    char buffer[65536];
    off_t offset = 0;
    while (true) {
        ssize_t n = STWRetryOnEINTR([&] { return pread(fd, buffer, sizeof buffer, offset); });
        if (n < 0) {
            STWSetError(error, STW_POSIX_ERROR_NOLOG(errno, "Cannot read an executable"));
            return std::nullopt;
        }
        if (n == 0)
            break;
        EVP_DigestUpdate(context.get(), buffer, static_cast<size_t>(n));
        offset += n;
    }
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned int digestLength = 0;
    EVP_DigestFinal_ex(context.get(), digest, &digestLength);
    std::string text = STWHexString(digest, digestLength);
    STWLockGuard guard(_digestLock);
    _digestLock_digests[key] = text;
    return text;
}

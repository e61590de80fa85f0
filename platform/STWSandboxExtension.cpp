#include "platform/STWSandboxExtension.h"

#include "common/STWFileIO.h"
#include "common/STWFormat.h"
#include "platform/STWPlatformConfiguration.h"

#include <cerrno>
#include <cstring>
#include <mutex>
#include <openssl/crypto.h>
#include <openssl/hmac.h>
#include <openssl/rand.h>

namespace {

constexpr size_t kKeySize = 32;

std::mutex keyLock;
std::optional<std::string> cachedKey;

} // namespace

std::filesystem::path STWSandboxExtension::keyFile() {
    return STWPlatformConfiguration::sharedInstance()->runtimeDirectory() / "extension.key";
}

bool STWSandboxExtension::createKey(const std::filesystem::path& file, STWErrorRef* error) {
    unsigned char bytes[kKeySize];
    if (RAND_bytes(bytes, sizeof bytes) != 1) {
        STWSetError(error, STW_POSIX_ERROR_NOLOG(EIO, "No random bytes for the key %@", file));
        return false;
    }
    std::string key(reinterpret_cast<const char*>(bytes), sizeof bytes);
    if (int e = STWWriteFileAtomically(file, key, 0600, true)) {
        STWSetError(error, STW_POSIX_ERROR_NOLOG(e, "Cannot write the key %@: %s", file, strerror(e)));
        return false;
    }
    std::lock_guard guard(keyLock);
    cachedKey = key;
    return true;
}

std::string STWSandboxExtension::tokenWithKey(const std::string& key, std::string_view extensionClass,
                                              std::string_view path, const STWAuditToken& auditToken) {
    std::string message(extensionClass);
    message.push_back('\0');
    message.append(path);
    message.push_back('\0');
    for (uint32_t word : auditToken.words)
        for (int shift = 0; shift < 32; shift += 8)
            message.push_back(static_cast<char>((word >> shift) & 0xff));
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned int length = 0;
    HMAC(EVP_sha256(), key.data(), static_cast<int>(key.size()), reinterpret_cast<const unsigned char*>(message.data()),
         message.size(), digest, &length);
    return STWHexString(digest, length);
}

std::optional<std::string> STWSandboxExtension::issueFileExtension(std::string_view extensionClass,
                                                                   std::string_view path,
                                                                   const STWAuditToken& auditToken,
                                                                   STWErrorRef* error) {
    std::string key;
    {
        std::lock_guard guard(keyLock);
        if (!cachedKey) {
            std::string contents;
            int e = STWReadFileContents(keyFile(), &contents, STWReadNoFollow, 4096);
            if (e == 0 && contents.size() != kKeySize)
                e = EINVAL;
            if (e) {
                STWSetError(error,
                            STW_POSIX_ERROR_NOLOG(e, "Cannot read the key %@: %s", keyFile(), strerror(e)));
                return std::nullopt;
            }
            cachedKey = contents;
        }
        key = *cachedKey;
    }
    return tokenWithKey(key, extensionClass, path, auditToken);
}

bool STWSandboxExtension::verify(std::string_view token, std::string_view extensionClass, std::string_view path,
                                 const STWAuditToken& auditToken, const std::string& key) {
    std::string expected = tokenWithKey(key, extensionClass, path, auditToken);
    return token.size() == expected.size() && CRYPTO_memcmp(token.data(), expected.data(), expected.size()) == 0;
}

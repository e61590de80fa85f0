// Sandbox extensions: a token that lets one process reach one path with one extension
// class. On Linux the token is an HMAC-SHA256, in lower-case hex, over
//     class, NUL, path, NUL, the eight audit-token words (little-endian)
// keyed by a secret made at the daemon's start in ROOT/run/stowly/extension.key (32
// random bytes, mode 0600). Whoever enforces access holds the same key and checks a token
// with verify(). Failures are POSIX-domain errors, left to the caller to log.
#pragma once

#include "common/STWError.h"
#include "platform/STWAuditToken.h"

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

class STWSandboxExtension {
public:
    static constexpr const char* containerClass = "com.vorlane.sandbox.container";
    static constexpr const char* applicationGroupClass = "com.vorlane.sandbox.application-group";

    // Makes a new key file (replacing any old one, so tokens of an earlier run stop
    // verifying).
    static bool createKey(const std::filesystem::path& keyFile, STWErrorRef* error);
    static std::filesystem::path keyFile();

    // A token for `path`, or nullopt when the key cannot be read.
    static std::optional<std::string> issueFileExtension(std::string_view extensionClass,
                                                         std::string_view path,
                                                         const STWAuditToken& auditToken, STWErrorRef* error);
    static bool verify(std::string_view token, std::string_view extensionClass, std::string_view path,
                       const STWAuditToken& auditToken, const std::string& key);
    static std::string tokenWithKey(const std::string& key, std::string_view extensionClass, std::string_view path,
                                    const STWAuditToken& auditToken);
};

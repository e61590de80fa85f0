// The users and groups database: ROOT/etc/passwd and ROOT/etc/group when the root prefix
// has them, else the system's own database. Home directories are resolved under the root.
#pragma once

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>
#include <sys/types.h>

struct STWUserRecord {
    std::string name;
    uid_t uid = 0;
    gid_t gid = 0;
    std::filesystem::path homeDirectory; // already under the root prefix
};

class STWUserDatabase {
public:
    static std::optional<STWUserRecord> userWithName(std::string_view name);
    static std::optional<STWUserRecord> userWithUID(uid_t uid);
    static std::optional<gid_t> groupIDWithName(std::string_view name);
    // The unprivileged owner of system containers' content: the user "nobody" and the group
    // "nogroup" (or "nobody"), 65534 where the database has no such entry.
    static uid_t nobodyUID();
    static gid_t nobodyGID();
    // The real path of `uid`'s home directory; the mobile user's home
    // (/private/var/mobile under the root prefix) when the user has none.
    static std::filesystem::path homeDirectoryURLForPOSIXUID(uid_t uid);
};

#include "platform/STWUserDatabase.h"

#include "common/STWLog.h"
#include "platform/STWPlatformConfiguration.h"

#include <climits>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <grp.h>
#include <pwd.h>
#include <vector>

namespace {

STWUserRecord recordFrom(const passwd& entry) {
    auto configuration = STWPlatformConfiguration::sharedInstance();
    return STWUserRecord{entry.pw_name ? entry.pw_name : "", entry.pw_uid, entry.pw_gid,
                         configuration->resolve(entry.pw_dir ? entry.pw_dir : "/")};
}

// Scans ROOT/etc/passwd; nullopt in the outer optional means the root has no such file.
std::optional<std::optional<STWUserRecord>> scanPasswd(const std::function<bool(const passwd&)>& matches) {
    auto configuration = STWPlatformConfiguration::sharedInstance();
    if (!configuration->hasPrivateRoot())
        return std::nullopt;
    FILE* file = fopen(configuration->resolve("/etc/passwd").c_str(), "re");
    if (!file)
        return std::nullopt;
    // The reentrant reader: lookups run on many threads at once.
    std::optional<STWUserRecord> found;
    std::vector<char> buffer(16384);
    passwd entry;
    passwd* result = nullptr;
    while (fgetpwent_r(file, &entry, buffer.data(), buffer.size(), &result) == 0 && result) {
        if (matches(entry)) {
            found = recordFrom(entry);
            break;
        }
    }
    fclose(file);
    return found;
}

std::optional<STWUserRecord> systemLookup(const std::function<int(passwd*, char*, size_t, passwd**)>& lookup) {
    std::vector<char> buffer(16384);
    passwd entry;
    passwd* result = nullptr;
    if (lookup(&entry, buffer.data(), buffer.size(), &result) != 0 || !result)
        return std::nullopt;
    return recordFrom(entry);
}

} // namespace

std::optional<STWUserRecord> STWUserDatabase::userWithName(std::string_view name) {
    std::string key(name);
    if (auto scanned = scanPasswd([&](const passwd& p) { return p.pw_name && key == p.pw_name; }))
        return *scanned;
    return systemLookup([&](passwd* p, char* b, size_t n, passwd** r) { return getpwnam_r(key.c_str(), p, b, n, r); });
}

std::optional<STWUserRecord> STWUserDatabase::userWithUID(uid_t uid) {
    if (auto scanned = scanPasswd([&](const passwd& p) { return p.pw_uid == uid; }))
        return *scanned;
    return systemLookup([&](passwd* p, char* b, size_t n, passwd** r) { return getpwuid_r(uid, p, b, n, r); });
}

std::optional<gid_t> STWUserDatabase::groupIDWithName(std::string_view name) {
    std::string key(name);
    auto configuration = STWPlatformConfiguration::sharedInstance();
    if (configuration->hasPrivateRoot()) {
        if (FILE* file = fopen(configuration->resolve("/etc/group").c_str(), "re")) {
            std::optional<gid_t> found;
            std::vector<char> buffer(16384);
            group entry;
            group* result = nullptr;
            while (fgetgrent_r(file, &entry, buffer.data(), buffer.size(), &result) == 0 && result) {
                if (entry.gr_name && key == entry.gr_name) {
                    found = entry.gr_gid;
                    break;
                }
            }
            fclose(file);
            return found;
        }
    }
    std::vector<char> buffer(16384);
    group entry;
    group* result = nullptr;
    if (getgrnam_r(key.c_str(), &entry, buffer.data(), buffer.size(), &result) != 0 || !result)
        return std::nullopt;
    return result->gr_gid;
}

uid_t STWUserDatabase::nobodyUID() {
    auto user = userWithName("nobody");
    return user ? user->uid : 65534;
}

gid_t STWUserDatabase::nobodyGID() {
    if (auto group = groupIDWithName("nogroup"))
        return *group;
    return groupIDWithName("nobody").value_or(65534);
}

std::filesystem::path STWUserDatabase::homeDirectoryURLForPOSIXUID(uid_t uid) {
    char real[PATH_MAX] = {};
    auto user = userWithUID(uid);
    if (!user)
        STW_LOG_ERROR(STWLogCategory::FS, "Failed to getpwuid for uid: %u", uid);
    else if (user->homeDirectory.is_absolute() && realpath(user->homeDirectory.c_str(), real))
        return real;
    STW_LOG_ERROR(STWLogCategory::FS, "Failed to get home dir using getpwuid for uid: %u", uid);
    // Real too, so that the paths made from either compare equal.
    std::filesystem::path mobile = STWPlatformConfiguration::sharedInstance()->resolve("/private/var/mobile");
    return realpath(mobile.c_str(), real) ? std::filesystem::path(real) : mobile;
}

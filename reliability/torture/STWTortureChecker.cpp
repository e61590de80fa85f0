#include "reliability/torture/STWTortureChecker.h"

#include <cerrno>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <memory>
#include <plist/plist.h>
#include <sstream>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <thread>
#include <unistd.h>

namespace {

constexpr const char* metadataFileName = ".com.vorlane.stowly.metadata.plist";
constexpr const char* protectionInfoKey = "com.vorlane.Setwright.ContentProtectionClass";
constexpr size_t metadataLimit = 1 << 20;

// The names in a directory, without "." and ".."; nullopt when it cannot be read (a
// directory that does not exist yet reads as empty).
std::optional<std::vector<std::string>> namesIn(const std::string& directory) {
    std::vector<std::string> names;
    DIR* d = opendir(directory.c_str());
    if (!d)
        return errno == ENOENT ? std::optional(names) : std::nullopt;
    while (dirent* entry = readdir(d))
        if (strcmp(entry->d_name, ".") != 0 && strcmp(entry->d_name, "..") != 0)
            names.emplace_back(entry->d_name);
    closedir(d);
    return names;
}

bool isUUIDName(const std::string& name) {
    if (name.size() != 36)
        return false;
    for (size_t i = 0; i < name.size(); ++i) {
        bool dash = i == 8 || i == 13 || i == 18 || i == 23;
        if (dash ? name[i] != '-' : !isxdigit(static_cast<unsigned char>(name[i])))
            return false;
    }
    return true;
}

struct PlistDeleter {
    void operator()(plist_t p) const { plist_free(p); }
};
using Plist = std::unique_ptr<void, PlistDeleter>;

std::optional<std::string> stringOf(plist_t dict, const char* key) {
    plist_t node = dict ? plist_dict_get_item(dict, key) : nullptr;
    if (!node || plist_get_node_type(node) != PLIST_STRING)
        return std::nullopt;
    uint64_t length = 0;
    const char* text = plist_get_string_ptr(node, &length);
    return text ? std::optional(std::string(text, length)) : std::nullopt;
}

std::optional<int64_t> integerOf(plist_t dict, const char* key) {
    plist_t node = dict ? plist_dict_get_item(dict, key) : nullptr;
    if (!node || plist_get_node_type(node) != PLIST_UINT)
        return std::nullopt;
    uint64_t value = 0;
    plist_get_uint_val(node, &value);
    return static_cast<int64_t>(value);
}

std::string setText(const std::set<std::string>& values) {
    std::string text = "{";
    for (const auto& v : values)
        text += (text.size() > 1 ? ", " : "") + v;
    return text + "}";
}

std::string setText(const std::set<int64_t>& values) {
    std::set<std::string> texts;
    for (int64_t v : values)
        texts.insert(std::to_string(v));
    return setText(texts);
}

std::string identityText(const STWTortureIdentity& identity) {
    return identity.second + " (class " + std::to_string(identity.first) + ")";
}

} // namespace

std::string STWTortureExpectation::description() const {
    std::ostringstream s;
    if (definitelyAbsent())
        return "absent";
    s << (mayBeAbsent ? "absent or present" : "present");
    s << " with UUID " << (uuids.empty() ? std::string("any") : setText(uuids));
    if (!excluded.empty())
        s << ", not at " << setText(excluded);
    if (!path.empty())
        s << " at " << path;
    if (!info.empty())
        s << ", info value " << setText(info);
    if (!protection.empty())
        s << ", protection class " << setText(protection);
    if (deletionAnswered)
        s << ", deleted unless the removal failed";
    return s.str();
}

bool STWTortureChecker::isPerUser(uint64_t containerClass) {
    return containerClass >= 2 && containerClass <= 11 && containerClass != 3 && containerClass != 5 &&
           containerClass != 8;
}

std::string STWTortureChecker::classDirectory(uint64_t containerClass, const std::string& home) {
    static const char* const names[] = {nullptr,             "Bundle/Application", "Data/Application",
                                        "Bundle/QuilletPlugin", "Data/QuilletPlugin", "Bundle/VPNPlugin",
                                        "Data/VPNPlugin",      "Shared/AppGroup",    "Bundle/Framework",
                                        "Data/TolvanService",  "Data/InternalDaemon", "Data/TempDir",
                                        "Data/System",         "Shared/SystemGroup"};
    if (containerClass < 1 || containerClass > 13)
        return {};
    return (isPerUser(containerClass) ? home + "/Containers/" : std::string("private/var/containers/")) +
           names[containerClass];
}

uint64_t STWTortureChecker::sandboxItemType(uint64_t containerClass) {
    switch (containerClass) {
    case 2: case 4: case 6: case 9: case 10: case 11:
        return 1;
    case 7:
        return 2;
    case 12:
        return 4;
    case 13:
        return 8;
    default:
        return 0;
    }
}

std::optional<STWTortureChecker::Container>
STWTortureChecker::_readContainer(uint64_t containerClass, const std::string& directory, const std::string& name,
                                  std::string* problem) const {
    std::string path = directory + "/" + name;
    struct stat st;
    if (lstat(path.c_str(), &st) != 0 || !S_ISDIR(st.st_mode))
        return *problem = "not a directory", std::nullopt;
    if (!isUUIDName(name))
        return *problem = "not named by a UUID", std::nullopt;
    std::string metadata = path + "/" + metadataFileName;
    int fd = open(metadata.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
    if (fd < 0)
        return *problem = std::string("no readable metadata file: ") + strerror(errno), std::nullopt;
    std::string bytes;
    if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode) || st.st_uid != 0 || size_t(st.st_size) > metadataLimit) {
        close(fd);
        return *problem = "metadata file is no regular root-owned file of sane size", std::nullopt;
    }
    bytes.resize(st.st_size);
    ssize_t n = pread(fd, bytes.data(), bytes.size(), 0);
    close(fd);
    if (n != ssize_t(bytes.size()) || bytes.empty())
        return *problem = "metadata file cannot be read whole", std::nullopt;
    plist_t raw = nullptr;
    plist_from_memory(bytes.data(), uint32_t(bytes.size()), &raw);
    Plist plist(raw);
    if (!raw || plist_get_node_type(raw) != PLIST_DICT)
        return *problem = "metadata file holds no property-list dictionary", std::nullopt;
    Container c;
    c.path = path;
    auto identifier = stringOf(raw, "STWMetadataIdentifier");
    auto uuid = stringOf(raw, "STWMetadataUUID");
    auto cls = integerOf(raw, "STWMetadataContentClass");
    if (!identifier || !uuid || !cls)
        return *problem = "metadata lacks identifier, UUID or class", std::nullopt;
    if (uint64_t(*cls) != containerClass)
        return *problem = "metadata says class " + std::to_string(*cls), std::nullopt;
    if (!isUUIDName(*uuid))
        return *problem = "metadata holds no UUID but \"" + *uuid + "\"", std::nullopt;
    c.containerClass = containerClass;
    c.identifier = *identifier;
    c.uuid = *uuid;
    plist_t user = plist_dict_get_item(raw, "STWMetadataUserIdentity");
    if (user && plist_get_node_type(user) == PLIST_DICT)
        c.persona = stringOf(user, "personaUniqueString").value_or("");
    plist_t info = plist_dict_get_item(raw, "STWMetadataInfo");
    if (info && plist_get_node_type(info) == PLIST_DICT) {
        c.info = integerOf(info, infoKey).value_or(-1);
        c.protection = integerOf(info, protectionInfoKey).value_or(-1);
    }
    int32_t documentsClass = 0;
    if (getxattr((path + "/Documents").c_str(), "trusted.stowly.protection-class", &documentsClass,
                 sizeof documentsClass) == sizeof documentsClass)
        c.documentsClass = documentsClass;
    return c;
}

bool STWTortureChecker::_records(const Container& c, const std::string& persona) const {
    if (!persona.empty())
        return c.persona == persona;
    for (const auto& [home, unique] : enterpriseHomes)
        if (unique == c.persona)
            return false;
    return true;
}

void STWTortureChecker::_scanDirectory(uint64_t containerClass, const std::string& home, const std::string& persona,
                                       std::vector<std::string>& violations) {
    std::string directory = _path(classDirectory(containerClass, home));
    auto names = namesIn(directory);
    if (!names) {
        // An enterprise home's class directories are made with its first container.
        if (errno != ENOENT || home == mobileHome)
            violations.push_back("cannot list " + directory + ": " + strerror(errno));
        return;
    }
    for (const auto& name : *names) {
        std::string problem;
        auto container = _readContainer(containerClass, directory, name, &problem);
        if (!container) {
            violations.push_back("incomplete container " + directory + "/" + name + ": " + problem);
            continue;
        }
        STWTortureIdentity identity{containerClass, container->identifier};
        if (isPerUser(containerClass) && !_records(*container, persona))
            violations.push_back(identityText(identity) + " at " + container->path + " records persona \"" +
                                 container->persona + "\", in the home of " +
                                 (persona.empty() ? std::string("the personal persona")
                                                  : "persona \"" + persona + "\""));
        auto [it, inserted] = _found.emplace(identity, *container);
        if (!inserted)
            violations.push_back("two containers for " + identityText(identity) + ": " + it->second.path + " and " +
                                 container->path);
    }
}

std::vector<std::string> STWTortureChecker::_scan() {
    std::vector<std::string> violations;
    _found.clear();
    for (uint64_t containerClass = 1; containerClass <= 13; ++containerClass) {
        _scanDirectory(containerClass, mobileHome, "", violations);
        if (isPerUser(containerClass))
            for (const auto& [home, persona] : enterpriseHomes)
                _scanDirectory(containerClass, home, persona, violations);
    }
    return violations;
}

std::vector<std::string> STWTortureChecker::_leftovers(std::chrono::milliseconds deathRowWait) const {
    std::vector<std::string> violations;
    auto mustBeEmpty = [&](const std::string& relative, const char* what) {
        auto names = namesIn(_path(relative));
        if (names && !names->empty())
            violations.push_back(std::string(what) + " left in " + _path(relative) + ": " + names->front() +
                                 (names->size() > 1 ? " and " + std::to_string(names->size() - 1) + " more" : ""));
    };
    mustBeEmpty("private/var/root/Library/Stowly/Replace", "replace journal");
    mustBeEmpty("private/var/root/Library/Stowly/PendingUpdates", "protection update file");
    std::vector<std::string> homes{mobileHome};
    for (const auto& [home, persona] : enterpriseHomes)
        homes.push_back(home);
    for (const auto& home : homes) {
        mustBeEmpty(home + "/Library/Stowly/Replace", "replace journal");
        mustBeEmpty(home + "/Library/Stowly/PendingUpdates", "protection update file");
        mustBeEmpty(home + "/Containers/Staging", "staging leftover");
    }
    mustBeEmpty("private/var/root/Library/Caches/com.vorlane.stowlyd/Staging", "staging leftover");
    // The death-row pass runs on its own queue after the cleanups are reported: wait a little.
    std::string deathRow = "private/var/root/Library/Caches/com.vorlane.stowlyd/Dead";
    auto deadline = std::chrono::steady_clock::now() + deathRowWait;
    while (std::chrono::steady_clock::now() < deadline) {
        auto names = namesIn(_path(deathRow));
        if (names && names->empty())
            return violations;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    mustBeEmpty(deathRow, "death row entry");
    return violations;
}

std::vector<std::string> STWTortureChecker::check(const std::vector<STWTortureModel*>& models,
                                                  std::chrono::milliseconds deathRowWait) {
    std::vector<std::string> violations = _scan();
    for (auto& v : _leftovers(deathRowWait))
        violations.push_back(std::move(v));

    // A recorded class is the one its data was given: a change records it only after the walk.
    // A change refused after its walk began (the device locked meanwhile, and it was not to
    // wait for the unlock) leaves what it changed, and the record as it was.
    std::set<STWTortureIdentity> partial;
    for (STWTortureModel* model : models)
        for (const auto& [identity, expected] : model->containers)
            if (expected.protectionMayBePartial)
                partial.insert(identity);
    for (const auto& [identity, c] : _found)
        if (identity.first == 2 && c.protection >= 0 && c.documentsClass != c.protection && !recordedProtectionMayLag &&
            !partial.count(identity))
            violations.push_back(identityText(identity) + " records protection class " +
                                 std::to_string(c.protection) + ", its Documents has class " +
                                 std::to_string(c.documentsClass));

    for (STWTortureModel* model : models) {
        for (auto& [identity, expected] : model->containers) {
            auto it = _found.find(identity);
            const Container* c = it == _found.end() ? nullptr : &it->second;
            std::string problem;
            if (!c && !expected.mayBeAbsent)
                problem = "missing";
            else if (c && !expected.mayBePresent)
                problem = "present at " + c->path;
            else if (c && expected.deletionAnswered && !undeletable.count(c->path))
                problem = "present at " + c->path + ", its deletion answered success and nothing failed there";
            else if (c && !expected.uuids.empty() && !expected.uuids.count(c->uuid))
                problem = "has UUID " + c->uuid;
            else if (c && expected.excluded.count(c->path))
                problem = "is still at " + c->path;
            else if (c && !expected.path.empty() && expected.path != c->path)
                problem = "is at " + c->path;
            else if (c && !expected.info.empty() && !expected.info.count(c->info))
                problem = "has info value " + std::to_string(c->info);
            else if (c && !expected.protection.empty() && !expected.protection.count(c->protection))
                problem = "has protection class " + std::to_string(c->protection);
            else if (c && isPerUser(identity.first) && !_records(*c, model->persona))
                problem = "belongs to persona \"" + c->persona + "\"";
            if (!problem.empty())
                violations.push_back(identityText(identity) + " " + problem + "; expected " +
                                     expected.description());
            // From here on the disk is what the clients build on.
            expected = c ? STWTortureExpectation::present(c->uuid, c->path) : STWTortureExpectation::absent();
            if (c) {
                expected.info = {c->info};
                expected.protection = {c->protection};
                expected.protectionMayBePartial = c->documentsClass != c->protection;
            }
        }
    }

    // Application groups: a container only for a group some stored entry names.
    for (const auto& [identity, c] : _found) {
        if (identity.first != 7)
            continue;
        bool referenced = false;
        for (STWTortureModel* model : models)
            referenced = referenced || model->mayReference(identity.second);
        if (!referenced)
            violations.push_back("group container " + c.path + " of " + identity.second +
                                 ", which no stored code-signing entry names");
    }
    return violations;
}

std::vector<std::string> STWTortureChecker::checkMappings(const std::vector<STWTortureIdentity>& mapped) const {
    std::vector<std::string> violations;
    // (item type, identifier) -> every path a mapping points at.
    std::map<std::pair<uint64_t, std::string>, std::vector<std::string>> links;
    std::string base = _path("run/stowly/sandbox");
    for (const auto& uid : namesIn(base).value_or(std::vector<std::string>()))
        for (const auto& persona : namesIn(base + "/" + uid).value_or(std::vector<std::string>()))
            for (const auto& type : namesIn(base + "/" + uid + "/" + persona).value_or(std::vector<std::string>())) {
                std::string directory = base + "/" + uid + "/" + persona + "/" + type;
                for (const auto& name : namesIn(directory).value_or(std::vector<std::string>())) {
                    char target[4096];
                    ssize_t n = readlink((directory + "/" + name).c_str(), target, sizeof target - 1);
                    if (n < 0) {
                        violations.push_back("sandbox mapping " + directory + "/" + name + " is no link");
                        continue;
                    }
                    links[{std::stoull(type), name}].emplace_back(target, size_t(n));
                }
            }
    for (const auto& [key, targets] : links) {
        const Container* owner = nullptr;
        for (const auto& [identity, c] : _found)
            if (identity.second == key.second && sandboxItemType(identity.first) == key.first)
                owner = &c;
        for (const auto& target : targets)
            if (!owner || target != owner->path)
                violations.push_back("sandbox mapping of " + key.second + " (item type " + std::to_string(key.first) +
                                     ") points at " + target + ", but the container " +
                                     (owner ? "is at " + owner->path : std::string("is gone")));
    }
    for (const auto& identity : mapped) {
        auto it = _found.find(identity);
        uint64_t type = sandboxItemType(identity.first);
        if (it == _found.end() || !type)
            continue;
        if (!links.count({type, identity.second}))
            violations.push_back("no sandbox mapping for " + identityText(identity) + " at " + it->second.path);
    }
    return violations;
}

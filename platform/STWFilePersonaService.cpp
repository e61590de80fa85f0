#include "platform/STWFilePersonaService.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWFileIO.h"
#include "common/STWLog.h"
#include "common/STWPropertyList.h"
#include "platform/STWFileWatcher.h"
#include "platform/STWPlatformConfiguration.h"
#include "platform/STWUserDatabase.h"

#include <cerrno>
#include <cstring>
#include <utility>

std::filesystem::path STWFilePersonaService::personaFile() {
    return STWPlatformConfiguration::sharedInstance()->configurationDirectory() / "personas.plist";
}

std::vector<STWPersonaRecord> STWFilePersonaService::recordsFromPlist(const STWValue& root) {
    std::vector<STWPersonaRecord> records;
    const STWValue::Array* entries = root.array();
    if (!entries) {
        STW_LOG_ERROR(STWLogCategory::Unspecified, "Persona list is not an array: %@", root);
        return records;
    }
    auto configuration = STWPlatformConfiguration::sharedInstance();
    for (const STWValue& entry : *entries) {
        const STWValue* id = entry.find("PersonaID");
        const STWValue* type = entry.find("Type");
        uint64_t personaID = id ? id->uint64Value().value_or(UINT64_MAX) : UINT64_MAX;
        const std::string* typeName = type ? type->string() : nullptr;
        if (personaID > UINT32_MAX || !typeName) {
            STW_LOG_ERROR(STWLogCategory::Unspecified, "Skipping persona without PersonaID or Type: %@", entry);
            continue;
        }
        STWPersonaRecord record;
        record.personaID = static_cast<uint32_t>(personaID);
        if (*typeName == "personal")
            record.kind = STWPersonaRecord::Kind::Personal;
        else if (*typeName == "enterprise")
            record.kind = STWPersonaRecord::Kind::Enterprise;
        else if (*typeName == "universal")
            record.kind = STWPersonaRecord::Kind::Universal;
        else if (*typeName == "system")
            record.kind = STWPersonaRecord::Kind::System;
        else {
            STW_LOG_ERROR(STWLogCategory::Unspecified, "Skipping persona of unknown type: %@", entry);
            continue;
        }
        if (const STWValue* unique = entry.find("PersonaUniqueString"); unique && unique->string())
            record.uniqueString = *unique->string();
        if (const STWValue* bundles = entry.find("BundleIdentifiers"); bundles && bundles->array())
            for (const STWValue& b : *bundles->array())
                if (b.string())
                    record.bundleIdentifiers.push_back(*b.string());
        if (const STWValue* home = entry.find("HomeLayoutPath"); home && home->string() && !home->string()->empty()) {
            // The persona's containers are made there, so it must name a place below the
            // root prefix: a relative path would follow the daemon's working directory.
            const std::string& path = *home->string();
            if (path.front() != '/' || containsDotDotPathComponents(path)) {
                STW_LOG_ERROR(STWLogCategory::Unspecified, "Skipping persona whose HomeLayoutPath is not absolute: %@",
                              entry);
                continue;
            }
            record.homeLayoutPath = configuration->resolve(path);
        }
        if (const STWValue* kernelType = entry.find("KernelType"))
            record.kernelType = static_cast<uint32_t>(kernelType->uint64Value().value_or(0));
        records.push_back(std::move(record));
    }
    return records;
}

STWFilePersonaService::STWFilePersonaService() = default;

namespace {
// An empty name: changes were lost (the watch's queue overflowed), so it may be ours.
bool isPersonaFile(const std::string& name) { return name == "personas.plist" || name.empty(); }
} // namespace

void STWFilePersonaService::_watchOnce() {
    {
        STWLockGuard guard(_kept->lock);
        if (std::exchange(_kept->watched, true))
            return;
    }
    std::filesystem::path directory = personaFile().parent_path();
    std::error_code ec;
    std::filesystem::create_directories(directory, ec);
    STWFileWatcher::sharedInstance().addWatch(directory, [kept = _kept](const std::string& name) {
        if (isPersonaFile(name))
            kept->drop();
    });
}

std::vector<STWPersonaRecord> STWFilePersonaService::personaList() {
    _watchOnce();
    uint64_t generation;
    {
        STWLockGuard guard(_kept->lock);
        if (_kept->records)
            return *_kept->records;
        generation = _kept->generation;
    }
    std::vector<STWPersonaRecord> records = readList();
    STWLockGuard guard(_kept->lock);
    if (_kept->generation == generation)
        _kept->records = records;
    return records;
}

std::vector<STWPersonaRecord> STWFilePersonaService::readList() {
    std::string bytes;
    int e = STWReadFileContents(personaFile(), &bytes);
    if (e == ENOENT) {
        auto configuration = STWPlatformConfiguration::sharedInstance();
        auto mobile = STWUserDatabase::userWithName(configuration->mobileUserName());
        STWPersonaRecord personal;
        personal.uniqueString = defaultPersonalUniqueString;
        personal.personaID = mobile ? mobile->uid : 501;
        personal.kind = STWPersonaRecord::Kind::Personal;
        return {personal};
    }
    if (e) {
        STW_LOG_ERROR(STWLogCategory::Unspecified, "Could not read %@: %s", personaFile(), strerror(e));
        return {};
    }
    std::optional<STWValue> root = STWPropertyList::parse(bytes);
    if (!root) {
        STW_LOG_ERROR(STWLogCategory::Unspecified, "Persona list %@ is not a property list", personaFile());
        return {};
    }
    return recordsFromPlist(*root);
}

int STWFilePersonaService::registerForPersonaListUpdates(const std::string& observerName,
                                                         std::function<void()> onUpdate,
                                                         std::function<void(STWErrorRef)> completion) {
    std::filesystem::path directory = personaFile().parent_path();
    std::error_code ec;
    std::filesystem::create_directories(directory, ec);
    // The kept list goes first: an observer that asks at once must see the new one.
    int token = STWFileWatcher::sharedInstance().addWatch(directory, [onUpdate, kept = _kept](const std::string& name) {
        if (!isPersonaFile(name))
            return;
        kept->drop();
        onUpdate();
    });
    if (token < 0) {
        completion(STW_POSIX_ERROR_NOLOG(errno, "Could not watch %@ for %@", directory, observerName));
        return -1;
    }
    completion(nullptr);
    return token;
}

void STWFilePersonaService::unregisterForPersonaListUpdates(int token) {
    if (token >= 0)
        STWFileWatcher::sharedInstance().removeWatch(token);
}

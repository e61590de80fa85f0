// What older daemons kept elsewhere and the mapping takes in: the legacy mapping file,
// moved into the database when the mapping is created, and the code-signing info cached in
// a bundle container's metadata, taken in when an identifier's entitlements are asked for
// and the database has none.
#include "Daemon/CodeSigning/STWCodeSigningMapping.h"

#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Lifecycle/STWContainerCache.h"
#include "Daemon/Model/STWContainerIdentity.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWLog.h"
#include "platform/STWQueue.h"

#include <cerrno>

namespace {

constexpr auto kCategory = STWLogCategory::CodeSignMapping;

} // namespace

std::optional<STWValue::Dictionary> STWCodeSigningMapping::_readCodeSigningMappingFromDiskAtURL(
    const std::filesystem::path& url) {
    STWErrorRef error;
    auto mapping = STW_dictionaryWithContentsOfURL(url, 0, &error);
    if (!mapping && error && !error->isPOSIX(ENOENT))
        STW_LOG_ERROR(kCategory, "Failed to read code signing mapping file at %@ : %@", url, error);
    return mapping;
}

void STWCodeSigningMapping::_onQueue_migrateFromMappingFileToDBIfNecessary() {
    _assertOnQueue(__func__);
    std::filesystem::path url = STWGlobalConfiguration::sharedInstance()->libraryDirectory() / legacyMappingFileName;
    auto mapping = _readCodeSigningMappingFromDiskAtURL(url);
    if (!mapping || mapping->empty())
        return;
    STW_LOG_NOTICE(kCategory, "Migrating code signing info from file to DB");
    _onQueue_forgetRegistration(std::nullopt);
    uint16_t migrated = 0, failed = 0;
    for (const auto& [identifier, value] : *mapping) {
        static const STWValue::Dictionary empty;
        const STWValue::Dictionary* serialized = value.dictionary();
        auto entry = std::make_shared<STWCodeSigningEntry>(
            STWCodeSigningEntry::initWithSerializedDictionary(serialized ? *serialized : empty));
        STWErrorRef error;
        if (_codeSigningMappingDB->addCodeSigningEntry(entry, identifier, &error)) {
            ++migrated;
        } else {
            STW_LOG_ERROR(kCategory, "Failed to migrate code signing entry for %@ : %@", identifier, error);
            ++failed;
        }
    }
    STW_LOG_NOTICE(kCategory, "Successfully migrated %d entries, failed to migrate %d", migrated, failed);
    // Nothing written: the file stays and the next start tries again.
    if (migrated == 0)
        return;
    STWErrorRef removeError;
    if (!STWFileManager::defaultManager()->removeItemAtURL(url, &removeError))
        STW_LOG_ERROR(kCategory, "Failed to remove legacy code signing mapping file: %@", removeError);
}

std::optional<STWValue::Dictionary>
STWCodeSigningMapping::_migrateEntitlementsFromBundleContainer(const std::string& identifier) {
    // Off the queue: the container cache may itself call into the mapping.
    uint64_t code = STWErrorSuccess;
    auto identity =
        STWContainerIdentity::containerIdentityWithIdentifier(identifier, STWContainerClassBundleApplication, &code);
    if (!identity)
        return std::nullopt;
    STWErrorRef lookupError;
    auto container = STWContainerCache::sharedInstance()->containerForContainerIdentity(identity, false, false,
                                                                                        &lookupError);
    const STWValue::Dictionary* cached =
        container && container->info()
            ? STWDictionaryDictionary(*container->info(), "com.vorlane.Setwright.CachedCodeSigningInfo")
            : nullptr;
    if (!cached)
        return std::nullopt;
    STWValue::Dictionary info = *cached;
    STW_LOG_NOTICE(kCategory, "Migrating code signing info from bundle container upon request for %@", identifier);
    if (const STWValue* entitlements = STWDictionaryFind(info, "Entitlements"))
        info[STWEntitlementKey::entitlements] = *entitlements;
    else
        info.erase(STWEntitlementKey::entitlements);
    _queue->sync([&] {
        _onQueue_forgetRegistration(identifier);
        auto entry = std::make_shared<STWCodeSigningEntry>(info, STWContainerClassDataApplication);
        STWErrorRef writeError;
        if (!_codeSigningMappingDB->addCodeSigningEntry(entry, identifier, &writeError))
            STW_LOG_ERROR(kCategory, "Failed to write code signing info to DB for %@ : %@", identifier, writeError);
    });
    if (const STWValue::Dictionary* entitlements = STWDictionaryDictionary(info, STWEntitlementKey::entitlements))
        return *entitlements;
    return std::nullopt;
}

#include "Daemon/Model/STWUserIdentityCache.h"
#include "platform/STWUserDatabase.h"

#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "common/STWLog.h"
#include "platform/STWPlatformConfiguration.h"

#include <atomic>
#include <thread>

namespace {

std::atomic<int64_t> retryIntervalMilliseconds{1000};
constexpr unsigned kLastResyncAttempt = 60;

void mobileIDs(uid_t& uid, gid_t& gid) {
    auto configuration = STWGlobalConfiguration::sharedInstance();
    uid = configuration->currentMobileUserId();
    gid = configuration->currentMobileGroupId();
    if (uid < 501) {
        // Without a usable mobile user no identity could be made at all.
        uid = 501;
        gid = 501;
    }
}

STWValue describeRecords(const std::vector<STWPersonaRecord>& records) {
    STWValue::Array array;
    for (const STWPersonaRecord& r : records)
        array.push_back(STWValue(r.description()));
    return STWValue(std::move(array));
}

} // namespace

std::shared_ptr<STWUserIdentityCache> STWUserIdentityCache::create() {
    std::shared_ptr<STWUserIdentityCache> cache(new STWUserIdentityCache);
    cache->_registerForPersonaListUpdates();
    return cache;
}

void STWUserIdentityCache::_registerForPersonaListUpdates() {
    std::weak_ptr<STWUserIdentityCache> weak = weak_from_this();
    _personaService = STWPersonaService::sharedInstance();
    _registrationToken = _personaService->registerForPersonaListUpdates(
        "com.vorlane.stowlyd.personaobserver",
        [weak] {
            if (auto strong = weak.lock())
                strong->personaListDidUpdate();
        },
        [weak](STWErrorRef error) {
            auto strong = weak.lock();
            if (!strong)
                return;
            if (error) {
                STW_LOG_FAULT(STWLogCategory::Unspecified, "Failed to register for persona list updates: %@", error);
                return;
            }
            strong->_registered = true;
            STW_LOG_NOTICE(STWLogCategory::Unspecified, "Registered for persona list updates.");
        });
}

STWUserIdentityCache::STWUserIdentityCache() {
    flush();
    _flushQueue = STWQueue::create("com.vorlane.stowlyd.STWUserIdentityCache.flushQueue");
}

STWUserIdentityCache::~STWUserIdentityCache() { unregister(); }

STWUserIdentityRef STWUserIdentityCache::defaultUserIdentity() {
    static const STWUserIdentityRef identity = [] {
        uid_t uid;
        gid_t gid;
        mobileIDs(uid, gid);
        return STWUserIdentity::initWithUID(uid, gid, STWUserDatabase::homeDirectoryURLForPOSIXUID(uid), std::nullopt,
                                            STWPersonaTypePersonal, uid);
    }();
    return identity;
}

bool STWUserIdentityCache::personasAreSupported() {
    static const bool supported = [] {
        auto configuration = STWPlatformConfiguration::sharedInstance();
        // Multi-user devices, devices without the capability and ephemeral storage have no personas.
        return !configuration->isMultiUser() && !configuration->personasUnsupported() &&
               !configuration->hasEphemeralStorage();
    }();
    return supported;
}

void STWUserIdentityCache::setResyncRetryInterval(std::chrono::milliseconds interval) {
    retryIntervalMilliseconds = interval.count();
}

void STWUserIdentityCache::_applyBaseUserIDRule(uid_t& uid, gid_t& gid) {
    if (uid < 501)
        mobileIDs(uid, gid);
}

void STWUserIdentityCache::_lock_makeValid() {
    if (_cacheInvalid)
        _lock_resync();
}

void STWUserIdentityCache::_lock_flush() {
    _cacheInvalid = true;
    _lock_bundleToEnterpriseIdentitiesMap.clear();
    _lock_personaUniqueStringToUserIdentityMap.clear();
    _lock_personaIDToUserIdentityMap.clear();
    _lock_userIdentityForPersonalPersona = defaultUserIdentity();
    _lock_userIdentityForUnspecificPersona = defaultUserIdentity();
}

void STWUserIdentityCache::_lock_resync() {
    if (personasAreSupported()) {
        for (unsigned attempt = 0;; ++attempt) {
            std::vector<STWPersonaRecord> personas = STWPersonaService::sharedInstance()->personaList();
            STW_LOG_DEBUG(STWLogCategory::Unspecified, "Got userPersonaAttributes: %@ on try: %lu",
                          describeRecords(personas), attempt);
            if (!personas.empty() && _lock_resync_fromUserPersonaAttributes(personas))
                break;
            if (personas.empty() && attempt == 0) {
                STW_LOG_ERROR(STWLogCategory::Unspecified, "Did not receive any persona attributes: %@",
                              describeRecords(personas));
                STW_LOG_FAULT(STWLogCategory::Unspecified, "Did not receive any persona attributes: %@",
                              describeRecords(personas));
            }
            if (attempt == kLastResyncAttempt) {
                STW_LOG_ERROR(STWLogCategory::Unspecified,
                              "Could not obtain persona attributes after exhausting retries, crashing");
                STW_FATAL("Could not obtain persona attributes after exhausting retries.");
            }
            std::this_thread::sleep_for(std::chrono::milliseconds(retryIntervalMilliseconds.load()));
        }
    }
    _cacheInvalid = false;
}

bool STWUserIdentityCache::_lock_resync_fromUserPersonaAttributes(const std::vector<STWPersonaRecord>& personas) {
    const STWPersonaRecord* personalRecord = nullptr;
    for (const STWPersonaRecord& record : personas) {
        if (record.isPersonal()) {
            personalRecord = &record;
            break;
        }
    }
    if (!personalRecord) {
        STW_LOG_ERROR(STWLogCategory::Unspecified, "Expected to find a personal persona in %@", describeRecords(personas));
        STW_LOG_FAULT(STWLogCategory::Unspecified, "Expected to find a personal persona in %@", describeRecords(personas));
        return false;
    }
    if (!personalRecord->uniqueString) {
        STW_LOG_ERROR(STWLogCategory::Unspecified, "Invalid persona unique string for personal %@", *personalRecord);
        return false;
    }
    STWUserIdentityRef personal = userIdentityWithPersonaAttributes(personalRecord, false);
    STWUserIdentityRef unspecific = userIdentityWithPersonaAttributes(personalRecord, true);
    if (!personal || !unspecific) {
        STW_LOG_ERROR(STWLogCategory::Unspecified, "Expected to find a personal persona in %@", describeRecords(personas));
        return false;
    }
    std::unordered_map<std::string, STWUserIdentitySet> bundleMap;
    std::unordered_map<std::string, STWUserIdentityRef> uniqueMap{{*personalRecord->uniqueString, personal}};
    std::unordered_map<uint32_t, STWUserIdentityRef> idMap{{personalRecord->personaID, personal}};
    STW_LOG_NOTICE(STWLogCategory::Unspecified, "Found personal persona %@: created personal %@, unspecific %@",
                   *personalRecord, personal, unspecific);

    std::vector<std::string> commonBundles;
    for (const STWPersonaRecord& record : personas) {
        if (!record.isUniversal() && !record.isSystem())
            continue;
        commonBundles.insert(commonBundles.end(), record.bundleIdentifiers.begin(), record.bundleIdentifiers.end());
        if (record.uniqueString)
            uniqueMap[*record.uniqueString] = unspecific;
        idMap[record.personaID] = unspecific;
    }
    for (const STWPersonaRecord& record : personas) {
        if (!record.isEnterprise())
            continue;
        if (!record.uniqueString) {
            STW_LOG_ERROR(STWLogCategory::Unspecified, "Invalid persona unique string for %@", record);
            STW_LOG_FAULT(STWLogCategory::Unspecified, "Invalid persona unique string for %@", record);
            continue;
        }
        STWUserIdentityRef identity = userIdentityWithPersonaAttributes(&record, false);
        STW_LOG_NOTICE(STWLogCategory::Unspecified, "Creating user identity for %@: %@", record, identity);
        if (!identity)
            continue;
        uniqueMap[*record.uniqueString] = identity;
        idMap[record.personaID] = identity;
        for (const std::string& bundle : record.bundleIdentifiers)
            bundleMap[bundle].insert(identity);
        for (const std::string& bundle : commonBundles)
            bundleMap[bundle].insert(identity);
    }
    for (const std::string& bundle : commonBundles)
        bundleMap[bundle].insert(personal);

    _lock_bundleToEnterpriseIdentitiesMap = std::move(bundleMap);
    _lock_personaUniqueStringToUserIdentityMap = std::move(uniqueMap);
    _lock_personaIDToUserIdentityMap = std::move(idMap);
    _lock_userIdentityForPersonalPersona = personal;
    _lock_userIdentityForUnspecificPersona = unspecific;
    return true;
}

STWUserIdentityRef STWUserIdentityCache::_lock_identityWithIDs(const STWUserIdentityRef& identity, uid_t uid,
                                                               gid_t gid) {
    if (!identity || (identity->posixUID() == uid && identity->posixGID() == gid))
        return identity;
    return identity->copyWithUID(uid, gid);
}

STWUserIdentityRef STWUserIdentityCache::userIdentityForLegacyMobileUser() {
    static const STWUserIdentityRef identity = STWUserIdentity::init();
    return identity;
}

STWUserIdentityRef STWUserIdentityCache::userIdentityForPersonalPersona() {
    uid_t uid;
    gid_t gid;
    mobileIDs(uid, gid);
    return userIdentityForPersonalPersonaWithUID(uid, gid);
}

STWUserIdentityRef STWUserIdentityCache::userIdentityForPersonalPersonaWithUID(uid_t uid, gid_t gid) {
    _applyBaseUserIDRule(uid, gid);
    STWUniqueLock lock(_lock);
    _lock_makeValid();
    return _lock_identityWithIDs(_lock_userIdentityForPersonalPersona, uid, gid);
}

STWUserIdentityRef STWUserIdentityCache::unspecificUserIdentity() {
    STWUniqueLock lock(_lock);
    _lock_makeValid();
    return _lock_userIdentityForUnspecificPersona;
}

STWUserIdentityRef STWUserIdentityCache::userIdentityForCurrentUserWithPersonaUniqueString(
    const std::optional<std::string>& unique) {
    if (!personasAreSupported())
        return userIdentityForPersonalPersona();
    STWUniqueLock lock(_lock);
    _lock_makeValid();
    if (!unique)
        return _lock_userIdentityForUnspecificPersona;
    auto it = _lock_personaUniqueStringToUserIdentityMap.find(*unique);
    return it == _lock_personaUniqueStringToUserIdentityMap.end() ? nullptr : it->second;
}

STWUserIdentityRef STWUserIdentityCache::userIdentityForPersonaUniqueString(const std::optional<std::string>& unique,
                                                                            uid_t uid, gid_t gid) {
    _applyBaseUserIDRule(uid, gid);
    if (!personasAreSupported())
        return userIdentityForPersonalPersonaWithUID(uid, gid);
    STWUniqueLock lock(_lock);
    _lock_makeValid();
    STWUserIdentityRef identity;
    if (!unique) {
        identity = _lock_userIdentityForUnspecificPersona;
    } else if (auto it = _lock_personaUniqueStringToUserIdentityMap.find(*unique);
               it != _lock_personaUniqueStringToUserIdentityMap.end()) {
        identity = it->second;
    }
    return _lock_identityWithIDs(identity, uid, gid);
}

STWUserIdentityRef STWUserIdentityCache::userIdentityWithPersonaID(uint32_t personaID) {
    STWUniqueLock lock(_lock);
    _lock_makeValid();
    auto it = _lock_personaIDToUserIdentityMap.find(personaID);
    return it == _lock_personaIDToUserIdentityMap.end() ? nullptr : it->second;
}

STWUserIdentitySet STWUserIdentityCache::userIdentitiesForBundleIdentifier(const std::string& bundleIdentifier) {
    STWUniqueLock lock(_lock);
    _lock_makeValid();
    auto it = _lock_bundleToEnterpriseIdentitiesMap.find(bundleIdentifier);
    if (it != _lock_bundleToEnterpriseIdentitiesMap.end())
        return it->second;
    lock.unlock();
    return STWUserIdentitySet{userIdentityForPersonalPersona()};
}

bool STWUserIdentityCache::isBundleIdentifier(const std::string& bundleIdentifier,
                                              const STWUserIdentityRef& associatedWithUserIdentity) {
    if (!personasAreSupported())
        return true;
    return userIdentitiesForBundleIdentifier(bundleIdentifier).count(associatedWithUserIdentity) > 0;
}

STWUserIdentityRef STWUserIdentityCache::userIdentityForCurrentContext() {
    uid_t uid;
    gid_t gid;
    mobileIDs(uid, gid);
    return userIdentityForCurrentContextWithUID(uid, gid);
}

STWUserIdentityRef STWUserIdentityCache::userIdentityForCurrentContextWithUID(uid_t uid, gid_t gid) {
    _applyBaseUserIDRule(uid, gid);
    if (!personasAreSupported()) {
        STWUserIdentityRef identity = userIdentityForPersonalPersonaWithUID(uid, gid);
        STW_LOG_DEBUG(STWLogCategory::Unspecified, "(%d/%d) Personas not supported, using: %@", uid, gid, identity);
        return identity;
    }
    std::optional<STWPersonaRecord> persona = STWPersonaService::sharedInstance()->currentPersona();
    if (persona && persona->isPersonal()) {
        STWUserIdentityRef identity = userIdentityForPersonalPersonaWithUID(uid, gid);
        STW_LOG_DEBUG(STWLogCategory::Unspecified, "(%d/%d) Explicit personal persona, using: %@", uid, gid, identity);
        return identity;
    }
    if (persona && persona->isEnterprise() && persona->uniqueString) {
        STWUserIdentityRef identity = userIdentityForPersonaUniqueString(persona->uniqueString, uid, gid);
        STW_LOG_DEBUG(STWLogCategory::Unspecified, "(%d/%d) Looked up user identity for [%@]: %@", uid, gid,
                      *persona->uniqueString, identity);
        return identity;
    }
    STWUserIdentityRef identity = userIdentityForPersonaUniqueString(std::nullopt, uid, gid);
    STW_LOG_DEBUG(STWLogCategory::Unspecified, "(%d/%d) No persona (<%p>) or no unique string [%@], using: %@", uid, gid,
                  persona ? static_cast<const void*>(&*persona) : nullptr,
                  persona && persona->uniqueString ? STWFormatArg(*persona->uniqueString) : STWFormatArg(nullptr),
                  identity);
    return identity;
}

void STWUserIdentityCache::forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
    const std::function<void(const STWUserIdentityRef&)>& block) {
    if (!personasAreSupported()) {
        block(defaultUserIdentity());
        return;
    }
    STWUserIdentitySet distinct;
    {
        STWUniqueLock lock(_lock);
        _lock_makeValid();
        for (const auto& [unique, identity] : _lock_personaUniqueStringToUserIdentityMap)
            distinct.insert(identity);
        if (distinct.empty())
            STW_LOG_ERROR(STWLogCategory::Unspecified,
                          "Expected to find at least one persona; self = %@, personaAttributeList = %@", *this,
                          describeRecords(STWPersonaService::sharedInstance()->personaList()));
    }
    if (distinct.empty()) {
        block(defaultUserIdentity());
        return;
    }
    for (const STWUserIdentityRef& identity : distinct)
        block(identity);
}

void STWUserIdentityCache::flush() {
    STWLockGuard guard(_lock);
    _lock_flush();
}

void STWUserIdentityCache::flushAndRepopulateWithUserIdentities(const std::vector<STWUserIdentityRef>& identities) {
    STWLockGuard guard(_lock);
    STWUserIdentityRef personal, unspecific;
    for (const STWUserIdentityRef& identity : identities) {
        if (!identity)
            continue;
        if (!identity->isEnterprise() && !identity->isNoSpecificPersona())
            personal = identity;
        if (identity->isNoSpecificPersona())
            unspecific = identity;
    }
    if (!personal)
        personal = defaultUserIdentity();
    if (!unspecific)
        unspecific = STWUserIdentity::initWithUID(personal->posixUID(), personal->posixGID(), personal->homeDirectoryURL(),
                                                  personal->personaUniqueString(), STWPersonaTypeUnspecific,
                                                  personal->kernelPersonaID());
    _lock_personaUniqueStringToUserIdentityMap.clear();
    _lock_personaIDToUserIdentityMap.clear();
    for (const STWUserIdentityRef& identity : identities) {
        if (!identity)
            continue;
        if (identity->personaUniqueString())
            _lock_personaUniqueStringToUserIdentityMap[*identity->personaUniqueString()] = identity;
        _lock_personaIDToUserIdentityMap[identity->kernelPersonaID()] = identity;
    }
    _lock_bundleToEnterpriseIdentitiesMap.clear();
    _lock_userIdentityForPersonalPersona = personal;
    _lock_userIdentityForUnspecificPersona = unspecific;
    _cacheInvalid = false;
}

void STWUserIdentityCache::personaListDidUpdate() {
    std::weak_ptr<STWUserIdentityCache> weak = weak_from_this();
    _flushQueue->async([weak] {
        if (auto strong = weak.lock())
            strong->flush();
    });
}

void STWUserIdentityCache::unregister() {
    _registered = false;
    int token = _registrationToken.exchange(-1);
    if (token >= 0 && _personaService)
        _personaService->unregisterForPersonaListUpdates(token);
}

std::string STWUserIdentityCache::description() const {
    return STWFormat("<%@: %p>", _className(), static_cast<const void*>(this));
}

bool STWUserIdentityCache::isRegistered() const { return _registered; }

bool STWUserIdentityCache::cacheInvalid() {
    STWLockGuard guard(_lock);
    return _cacheInvalid;
}

void STWUserIdentityCache::setCacheInvalid(bool invalid) {
    STWLockGuard guard(_lock);
    _cacheInvalid = invalid;
}

STWUserIdentityRef STWUserIdentityCache::userIdentityWithPersonaAttributes(const STWPersonaRecord* attributes) {
    return userIdentityWithPersonaAttributes(attributes, false);
}

STWUserIdentityRef STWUserIdentityCache::userIdentityWithPersonaAttributes(const STWPersonaRecord* attributes,
                                                                           bool forceUnspecific) {
    uid_t uid;
    gid_t gid;
    mobileIDs(uid, gid);
    return userIdentityWithPersonaAttributes(attributes, uid, gid, forceUnspecific);
}

STWUserIdentityRef STWUserIdentityCache::userIdentityWithPersonaAttributes(const STWPersonaRecord* attributes,
                                                                           uid_t uid, gid_t gid,
                                                                           bool forceUnspecific) {
    std::optional<std::string> unique = attributes ? attributes->uniqueString : std::nullopt;
    uint32_t kernelPersonaID = attributes ? attributes->personaID : uid;
    std::filesystem::path home = attributes && attributes->isEnterprise() && attributes->homeLayoutPath
                                     ? *attributes->homeLayoutPath
                                     : STWUserDatabase::homeDirectoryURLForPOSIXUID(uid);
    uint32_t type = STWPersonaTypeUnspecific;
    if (!forceUnspecific && attributes) {
        if (attributes->isPersonal())
            type = STWPersonaTypePersonal;
        else if (attributes->isEnterprise())
            type = STWPersonaTypeEnterprise;
    }
    return STWUserIdentity::initWithUID(uid, gid, home, std::move(unique), type, kernelPersonaID);
}

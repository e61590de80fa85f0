#include "tests/lifecycle/STWLifecycleTestSupport.h"
#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>
#include <stdexcept>

namespace {

std::string itemKey(const STWSandboxMappingItem& item) {
    return STWFormat("%u/%u/%llu/%@", item.uid, item.kernelPersonaID, static_cast<unsigned long long>(item.itemType),
                     item.identifier);
}

} // namespace

void STWLifecycleTestSetUpRoot() {
    STWTestRoot& root = STWTestRoot::shared();
    root.writePersonas({
        STWTestRoot::persona("PERSONAL", 1000, "personal"),
        STWTestRoot::persona("ENT-1", 1001, "enterprise",
                             {STWValue("com.work.mail"), STWValue("com.shared.app")}, "/private/var/ent1"),
        STWTestRoot::persona("UNIVERSAL", 1003, "universal", {STWValue("com.shared.app")}),
    });
    for (const char* path : {"/private/var/mobile/Containers", "/private/var/ent1", "/private/var/containers",
                             "/private/var/root/Library/Caches/com.vorlane.stowlyd/Temp", "/run/stowly/sandbox",
                             "/private/var/staged", "/private/var/outside"})
        STWFileManager::defaultManager()->removeItemAtURL(root.resolve(path));
}

STWUserIdentityRef STWTestPersonalIdentity() {
    return STWUserIdentitySharedCache::sharedInstance()->userIdentityForPersonalPersona();
}

STWUserIdentityRef STWTestEnterpriseIdentity() {
    return STWUserIdentitySharedCache::sharedInstance()->userIdentityForPersonaUniqueString(std::string("ENT-1"), 501,
                                                                                           501);
}

STWTestContainer STWMakeTestContainer(const STWUserIdentityRef& userIdentity, const std::string& identifier,
                                      STWContainerClass containerClass, bool transient,
                                      const std::optional<std::string>& directoryName) {
    STWUUID uuid = STWUUID::random();
    auto classDirectory = STWGlobalConfiguration::sharedInstance()->containerDirectoryURLForUserIdentity(
        userIdentity, containerClass, transient);
    EXPECT_TRUE(classDirectory);
    std::filesystem::path url = *classDirectory / directoryName.value_or(uuid.string());
    std::filesystem::create_directories(url);
    auto identity = STWConcreteContainerIdentity::containerIdentityWithUUID(uuid, userIdentity, identifier,
                                                                            containerClass, nullptr);
    auto metadata = std::make_shared<STWMetadata>(identity, std::nullopt, url, std::nullopt);
    metadata->setTransient(transient);
    STWErrorRef error;
    EXPECT_TRUE(metadata->writeMetadataToDiskWithError(&error)) << (error ? error->description() : "");
    return {url, metadata};
}

bool STWRecordingSandboxMappingStore::setUserStateItem(const STWSandboxMappingItem& item,
                                                       const std::optional<std::filesystem::path>& path,
                                                       STWErrorRef*) {
    if (throwOnSet)
        throw std::runtime_error("sandbox state store went away");
    std::lock_guard guard(_mutex);
    if (path) {
        _mappings[itemKey(item)] = *path;
        _pushes[item.identifier]++;
    } else {
        _mappings.erase(itemKey(item));
    }
    return true;
}

std::optional<std::filesystem::path> STWRecordingSandboxMappingStore::userStateItem(const STWSandboxMappingItem& item) {
    std::lock_guard guard(_mutex);
    auto it = _mappings.find(itemKey(item));
    return it == _mappings.end() ? std::nullopt : std::optional(it->second);
}

std::map<std::string, std::filesystem::path> STWRecordingSandboxMappingStore::mappings() {
    std::lock_guard guard(_mutex);
    return _mappings;
}

int STWRecordingSandboxMappingStore::pushCount(const std::string& identifier) {
    std::lock_guard guard(_mutex);
    auto it = _pushes.find(identifier);
    return it == _pushes.end() ? 0 : it->second;
}

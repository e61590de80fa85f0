// Migrations of what older daemons kept outside the database. Each test needs a process and
// root of its own: the mapping and the cache find what was on disk when they first looked.
#include "Daemon/CodeSigning/STWCodeSigningMapping.h"

#include "Daemon/Lifecycle/STWCommandQueue.h"
#include "Daemon/Lifecycle/STWContainerCache.h"
#include "Daemon/Migration/STWMigrationStatus.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "Daemon/Request/STWClientConnection.h"
#include "common/STWDictionaryUtilities.h"
#include "tests/lifecycle/STWLifecycleTestSupport.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

namespace fs = std::filesystem;

namespace {

using Strings = std::vector<std::string>;

constexpr const char* kCachedInfoKey = "com.vorlane.Setwright.CachedCodeSigningInfo";
constexpr const char* kGroupIDsKey = "com.vorlane.Setwright.GroupContainerIDs";

STWValue strings(const Strings& values) {
    return STWValue(STWValue::Array(values.begin(), values.end()));
}

STWValue::Dictionary entitlementsInfo(STWValue::Dictionary entitlements) {
    return {{STWEntitlementKey::entitlements, STWValue(std::move(entitlements))}};
}

fs::path library() {
    return STWGlobalConfiguration::sharedInstance()->libraryDirectory();
}

void writePlist(const fs::path& url, const STWValue::Dictionary& dictionary) {
    STWErrorRef error;
    ASSERT_TRUE(STW_writeToURL(dictionary, url, STWWriteAtomic, &error)) << url;
}

// A container on disk whose metadata carries one info value.
STWTestContainer containerWithInfo(const STWUserIdentityRef& user, const std::string& identifier,
                                   STWContainerClass containerClass, const char* key, STWValue value) {
    STWTestContainer container = STWMakeTestContainer(user, identifier, containerClass);
    STWMetadata metadata(*container.metadata);
    metadata.setInfo(STWValue::Dictionary{{key, std::move(value)}});
    STWErrorRef error;
    EXPECT_TRUE(metadata.writeMetadataToDiskWithError(&error));
    return container;
}

class STWCodeSigningMigrationTest : public ::testing::Test {
protected:
    void SetUp() override { STWLifecycleTestSetUpRoot(); }

    void start() {
        mapping = STWCodeSigningMapping::sharedInstance();
        ASSERT_TRUE(mapping);
    }
    void migrate() {
        mapping->performAllCodeSigningMigrationAndReconciliationWithCommandQueue(*queue);
        uint64_t error = STWErrorSuccess;
        queue->executeAllUntilExhaustedOrError(&error);
    }
    std::shared_ptr<const STWCodeSigningEntry> entry(const std::string& identifier) {
        return mapping->codeSigningEntryForIdentifier(identifier, nullptr);
    }
    // The info value as the cache (and so every later request) sees it.
    const STWValue* info(const STWTestContainer& container, const char* key) {
        found = STWContainerCache::sharedInstance()->containerForContainerIdentity(
            container.metadata->containerIdentity());
        return found && found->info() ? STWDictionaryFind(*found->info(), key) : nullptr;
    }

    std::shared_ptr<STWCodeSigningMapping> mapping;
    std::shared_ptr<STWCommandQueue> queue = STWCommandQueue::init();
    STWMetadataRef found;
};

} // namespace

TEST_F(STWCodeSigningMigrationTest, EachLegacyCopyIsTakenInOnceAndTheDatabaseWinsUnlessItsEntryIsInvalid) {
    // The legacy entitlements file, with a malformed value of each kind beside good ones.
    STWValue::Dictionary legacy{{"legacy", STWValue(true)}};
    writePlist(library() / STWCodeSigningMapping::legacyEntitlementsFileName,
               {{"com.t.valid", STWValue(legacy)},
                {"com.t.invalid", STWValue(legacy)},
                {"com.t.unregistered", STWValue(legacy)},
                {"com.t.caller", STWValue(legacy)},
                {"com.t.broken", STWValue("not entitlements")},
                {"com.vorlane.Stowly.ChildPluginBundleIDs",
                 STWValue(STWValue::Dictionary{{"com.t.caller", strings({"com.t.caller.ext"})},
                                               {"com.t.unregistered", STWValue(5)}})},
                {"com.vorlane.Stowly.EntitlementsRegisteredByCaller",
                 STWValue(STWValue::Dictionary{{"com.t.caller", STWValue(true)},
                                               {"com.t.unregistered", STWValue("yes")}})},
                {"com.vorlane.Stowly.PlaceholderEntitlements",
                 STWValue(STWValue::Dictionary{{"com.t.caller", STWValue(0)}})}});

    // Cached code-signing info in bundle containers.
    STWValue::Dictionary cachedEntitlements{{"cached", STWValue(true)}};
    STWValue cached(
        STWValue::Dictionary{{"Entitlements", STWValue(cachedEntitlements)}, {"Other", STWValue(1)}});
    auto user = STWUserIdentityCache::defaultUserIdentity();
    auto framework =
        containerWithInfo(user, "com.t.framework", STWContainerClassBundleFramework, kCachedInfoKey, cached);
    auto app =
        containerWithInfo(user, "com.t.app", STWContainerClassBundleApplication, kCachedInfoKey, cached);
    auto later = STWMakeTestContainer(user, "com.t.later", STWContainerClassBundleApplication);

    // Group identifiers of the legacy mobile user's data containers.
    auto mobile = STWUserIdentitySharedCache::sharedInstance()->userIdentityForLegacyMobileUser();
    auto grouped = containerWithInfo(mobile, "com.t.grouped", STWContainerClassDataApplication, kGroupIDsKey,
                                     strings({"DG"}));
    auto laterData = STWMakeTestContainer(mobile, "com.t.laterdata", STWContainerClassDataApplication);
    // Application group containers: one referenced by what is migrated, one by nothing.
    auto dataGroup = STWMakeTestContainer(STWTestPersonalIdentity(), "DG", STWContainerClassSharedAppGroup);
    auto orphan = STWMakeTestContainer(STWTestPersonalIdentity(), "orphan", STWContainerClassSharedAppGroup);

    start();
    STWValue::Dictionary installer = entitlementsInfo({{"installer", STWValue(true)}});
    for (const char* identifier : {"com.t.valid", "com.t.invalid"})
        ASSERT_EQ(mapping->processCodeSigningInfo(installer, identifier, {}, *queue), STWErrorSuccess);
    ASSERT_TRUE(mapping->invalidateCodeSigningInfoForIdentifier("com.t.invalid", nullptr));

    migrate();

    EXPECT_EQ(*entry("com.t.valid")->codeSigningInfo(), installer);
    auto replaced = entry("com.t.invalid");
    auto unregistered = entry("com.t.unregistered");
    auto caller = entry("com.t.caller");
    ASSERT_TRUE(replaced && unregistered && caller && entry("com.t.framework") && entry("com.t.app"));
    EXPECT_EQ(*replaced->codeSigningInfo(), entitlementsInfo(legacy));
    EXPECT_TRUE(replaced->invalid() && unregistered->invalid() && !unregistered->registeredByCaller());
    EXPECT_FALSE(unregistered->childBundleIdentifiers());
    EXPECT_TRUE(!caller->invalid() && caller->registeredByCaller() && caller->placeholder());
    EXPECT_EQ(caller->childBundleIdentifiers(), Strings{"com.t.caller.ext"});
    EXPECT_EQ(caller->dataContainerClass(), 0u);
    EXPECT_FALSE(entry("com.t.broken"));
    EXPECT_FALSE(fs::exists(library() / STWCodeSigningMapping::legacyEntitlementsFileName));

    STWValue::Dictionary converted = *cached.dictionary();
    converted[STWEntitlementKey::entitlements] = STWValue(cachedEntitlements);
    EXPECT_EQ(*entry("com.t.framework")->codeSigningInfo(), converted);
    EXPECT_EQ(entry("com.t.framework")->dataContainerClass(), 0u);
    EXPECT_EQ(entry("com.t.app")->dataContainerClass(), 2u);
    EXPECT_FALSE(info(framework, kCachedInfoKey) || info(app, kCachedInfoKey));

    auto migratedGroups = entry("com.t.grouped");
    ASSERT_TRUE(migratedGroups);
    EXPECT_TRUE(migratedGroups->invalid() && migratedGroups->dataContainerClass() == 2u);
    EXPECT_EQ(mapping->appGroupIdentifiersForIdentifier("com.t.grouped"), Strings{"DG"});
    EXPECT_FALSE(info(grouped, kGroupIDsKey));

    EXPECT_TRUE(fs::exists(dataGroup.url));
    EXPECT_FALSE(fs::exists(orphan.url));

    // Legacy data that shows up after a recorded migration stays where it is.
    auto connection = STWClientConnection::privilegedClientConnectionWithUserIdentity(user);
    uint64_t code = STWErrorSuccess;
    ASSERT_TRUE(connection->setInfoValue(cached, STWValue(kCachedInfoKey),
                                         later.metadata->containerIdentity(), true, &code));
    ASSERT_TRUE(STWClientConnection::privilegedClientConnectionWithUserIdentity(mobile)->setInfoValue(
        strings({"DG2"}), STWValue(kGroupIDsKey), laterData.metadata->containerIdentity(), true, &code));
    migrate();
    EXPECT_FALSE(entry("com.t.later") || entry("com.t.laterdata"));
    EXPECT_TRUE(info(later, kCachedInfoKey) && info(laterData, kGroupIDsKey));
}

TEST_F(STWCodeSigningMigrationTest, AMultiUserDeviceKeepsGroupIdentifiersAndGroupContainers) {
    start();
    auto mobile = STWUserIdentitySharedCache::sharedInstance()->userIdentityForLegacyMobileUser();
    auto grouped = containerWithInfo(mobile, "com.t.grouped", STWContainerClassDataApplication, kGroupIDsKey,
                                     strings({"DG"}));
    auto orphan = STWMakeTestContainer(STWTestPersonalIdentity(), "orphan", STWContainerClassSharedAppGroup);
    STWTestRoot::shared().writeSettings({{"MultiUser", STWValue(true)}});
    migrate();
    EXPECT_FALSE(entry("com.t.grouped"));
    EXPECT_TRUE(info(grouped, kGroupIDsKey));
    EXPECT_TRUE(fs::exists(orphan.url));
    auto status = STWMigrationStatus::initForSystemMigration();
    EXPECT_FALSE(status->hasMigrationOccurredForType(STWMigrationType::groupId));
    EXPECT_TRUE(status->hasMigrationOccurredForType(STWMigrationType::codeSigning));
}

// One entry that cannot be written (the empty identifier) does not keep the file.
TEST_F(STWCodeSigningMigrationTest, AMappingFileGoesOnceAnythingFromItIsWritten) {
    fs::path file = library() / STWCodeSigningMapping::legacyMappingFileName;
    STWCodeSigningEntry stored(entitlementsInfo({{"stored", STWValue(true)}}), 4);
    stored.setChildBundleIdentifiers(Strings{"com.t.one.ext"});
    writePlist(file, {{"com.t.one", STWValue(stored.serialize())},
                      {"com.t.two", STWValue(STWCodeSigningEntry(entitlementsInfo({})).serialize())},
                      {"", STWValue(stored.serialize())}});
    start();
    EXPECT_EQ(*entry("com.t.one"), stored);
    EXPECT_TRUE(entry("com.t.two"));
    EXPECT_FALSE(entry(""));
    EXPECT_FALSE(fs::exists(file));
}

// Each test needs a process and root of its own: the shared mapping and the container cache
// start empty and find what was on disk at their first look-up.
#include "Daemon/CodeSigning/STWCodeSigningMapping.h"
#include "Daemon/CodeSigning/STWGroupManager.h"

#include "Daemon/Lifecycle/STWCommandQueue.h"
#include "platform/STWQueue.h"
#include "tests/lifecycle/STWLifecycleTestSupport.h"

#include <gtest/gtest.h>

#include <sqlite3.h>

namespace {

using Strings = std::vector<std::string>;

STWValue strings(const Strings& values) { return STWValue(STWValue::Array(values.begin(), values.end())); }

STWValue::Dictionary entitlementsInfo(STWValue::Dictionary entitlements) {
    return {{STWEntitlementKey::entitlements, STWValue(std::move(entitlements))}};
}

STWValue::Dictionary appGroupsInfo(STWValue groups) {
    return entitlementsInfo({{STWEntitlementKey::applicationGroups, std::move(groups)}});
}

class STWCodeSigningMappingTest : public ::testing::Test {
protected:
    void SetUp() override {
        STWLifecycleTestSetUpRoot();
        mapping = STWCodeSigningMapping::sharedInstance();
        ASSERT_TRUE(mapping);
    }

    uint64_t process(const std::optional<STWValue::Dictionary>& info, const std::string& identifier,
                     STWValue::Dictionary options = {}) {
        return mapping->processCodeSigningInfo(info, identifier, options, *queue);
    }
    // Rows the database changed since it was opened.
    int changes() {
        return mapping->queue()->syncResult(
            [this] { return sqlite3_total_changes(mapping->codeSigningMappingDB().db()); });
    }
    // Runs what the updates queued, as the end of a request does.
    void completeRequest() {
        uint64_t error = STWErrorSuccess;
        queue->executeAllUntilExhaustedOrError(&error);
    }

    std::shared_ptr<STWCodeSigningMapping> mapping;
    std::shared_ptr<STWCommandQueue> queue = STWCommandQueue::init();
};

} // namespace

TEST_F(STWCodeSigningMappingTest, UpdatesWriteOnlyWhatChangedAndTheInstallerWins) {
    STWValue::Dictionary info = appGroupsInfo(strings({"G"}));
    STWValue::Dictionary options{{"com.vorlane.Stowly.DataContainerClass", STWValue(2)}};
    ASSERT_EQ(process(info, "com.t.app", options), STWErrorSuccess);
    int written = changes();
    ASSERT_EQ(process(info, "com.t.app", options), STWErrorSuccess);
    EXPECT_EQ(changes(), written);
    EXPECT_EQ(mapping->dataContainerTypeForIdentifier("com.t.app"), 2u);
    // The class is remembered, but never past a write (here, and for the child and the
    // uninstall below).
    ASSERT_EQ(process(info, "com.t.app", {{"com.vorlane.Stowly.DataContainerClass", STWValue(4)}}),
              STWErrorSuccess);
    EXPECT_EQ(mapping->dataContainerTypeForIdentifier("com.t.app"), 4u);

    // A caller's own entitlements never replace what the installer said.
    STWValue::Dictionary claimed{{STWEntitlementKey::applicationGroups, strings({"stolen"})}};
    EXPECT_EQ(mapping->processCallerRegisteredEntitlements(claimed, "com.t.app", *queue), STWErrorSuccess);
    EXPECT_EQ(mapping->appGroupIdentifiersForIdentifier("com.t.app"), Strings{"G"});
    EXPECT_FALSE(mapping->identifierHasCallerRegisteredEntitlements("com.t.app"));
    // A caller without installer information is recorded, once per change.
    ASSERT_EQ(mapping->processCallerRegisteredEntitlements(claimed, "com.t.self", *queue), STWErrorSuccess);
    written = changes();
    ASSERT_EQ(mapping->processCallerRegisteredEntitlements(claimed, "com.t.self", *queue), STWErrorSuccess);
    EXPECT_EQ(changes(), written);
    STWValue::Dictionary changed{{STWEntitlementKey::applicationGroups, strings({"other"})}};
    ASSERT_EQ(mapping->processCallerRegisteredEntitlements(changed, "com.t.self", *queue), STWErrorSuccess);
    EXPECT_TRUE(mapping->identifierHasCallerRegisteredEntitlements("com.t.self"));
    EXPECT_EQ(mapping->appGroupIdentifiersForIdentifier("com.t.self"), Strings{"other"});

    // A child whose parent is not stored is processed; no parent entry appears.
    ASSERT_EQ(process(info, "com.t.orphan.ext", {{"com.vorlane.Stowly.ParentBundleID", STWValue("com.t.absent")}}),
              STWErrorSuccess);
    EXPECT_TRUE(mapping->codeSigningEntryForIdentifier("com.t.orphan.ext", nullptr));
    EXPECT_FALSE(mapping->codeSigningEntryForIdentifier("com.t.absent", nullptr));
    // A stored parent learns its child, and forgetting the parent forgets the child too.
    ASSERT_EQ(process(info, "com.t.app.ext",
                      {{"com.vorlane.Stowly.ParentBundleID", STWValue("com.t.app")},
                       {"com.vorlane.Stowly.DataContainerClass", STWValue(4)}}),
              STWErrorSuccess);
    EXPECT_EQ(mapping->dataContainerTypeForIdentifier("com.t.app.ext"), 4u);
    EXPECT_EQ(mapping->parentIdentifierForChildIdentifier("com.t.app.ext"), "com.t.app");
    mapping->removeCodeSigningDictionariesForIdentifierAndItsChildren("com.t.app", *queue);
    EXPECT_FALSE(mapping->codeSigningEntryForIdentifier("com.t.app", nullptr));
    EXPECT_FALSE(mapping->codeSigningEntryForIdentifier("com.t.app.ext", nullptr));
    EXPECT_EQ(mapping->dataContainerTypeForIdentifier("com.t.app"), 0u);
}

TEST_F(STWCodeSigningMappingTest, InvalidEntriesStayQueryableAndTheSweepSparesWhatStillHasAReason) {
    // Bundle containers exist for two apps; one of them still carries the code-signing info
    // an older daemon cached in its metadata.
    STWMakeTestContainer(STWTestPersonalIdentity(), "com.t.installed", STWContainerClassBundleApplication);
    auto legacy = STWMakeTestContainer(STWTestPersonalIdentity(), "com.t.legacy", STWContainerClassBundleApplication);
    STWMetadata metadata(*legacy.metadata);
    STWValue::Dictionary legacyEntitlements{{"com.t.flag", STWValue(true)}};
    metadata.setInfo(STWValue::Dictionary{
        {"com.vorlane.Setwright.CachedCodeSigningInfo",
         STWValue(STWValue::Dictionary{{"Entitlements", STWValue(legacyEntitlements)}})}});
    STWErrorRef error;
    ASSERT_TRUE(metadata.writeMetadataToDiskWithError(&error));

    EXPECT_EQ(mapping->entitlementsForIdentifier("com.t.legacy"), legacyEntitlements);
    EXPECT_EQ(mapping->dataContainerTypeForIdentifier("com.t.legacy"), 2u);

    STWValue::Dictionary info = appGroupsInfo(strings({"G"}));
    ASSERT_EQ(process(info, "com.t.installed"), STWErrorSuccess);
    ASSERT_EQ(process(info, "com.t.gone"), STWErrorSuccess);
    ASSERT_EQ(process(info, "com.t.installed.ext",
                      {{"com.vorlane.Stowly.ParentBundleID", STWValue("com.t.installed")},
                       {"com.vorlane.Stowly.DataContainerClass", STWValue(4)}}),
              STWErrorSuccess);
    ASSERT_EQ(mapping->processCallerRegisteredEntitlements({}, "com.t.registered", *queue), STWErrorSuccess);
    ASSERT_EQ(mapping->invalidateCodeSigningInfoForAppsWithoutBundleContainer(), STWErrorSuccess);

    EXPECT_FALSE(mapping->getCodeSigningInfoForIdentifier("com.t.gone"));
    EXPECT_EQ(mapping->appGroupIdentifiersForIdentifier("com.t.gone"), Strings{"G"});
    for (const char* kept : {"com.t.installed", "com.t.installed.ext", "com.t.registered", "com.t.legacy"})
        EXPECT_TRUE(mapping->getCodeSigningInfoForIdentifier(kept)) << kept;
    // Placeholders are hidden from callers too, but their entitlements count.
    ASSERT_EQ(process(info, "com.t.placeholder", {{"com.vorlane.Stowly.PlaceholderEntitlements", STWValue(true)}}),
              STWErrorSuccess);
    EXPECT_FALSE(mapping->getCodeSigningInfoForIdentifier("com.t.placeholder"));
    EXPECT_EQ((*mapping->copyReferenceCountSetOfType(STWGroupTypeApplication))["G"], 4);
}

TEST_F(STWCodeSigningMappingTest, GroupIdentifiersComeOnlyFromWellFormedEntitlements) {
    using M = STWCodeSigningMapping;
    const char* key = STWEntitlementKey::applicationGroups;
    EXPECT_EQ(M::_copyApplicationGroupEntitlementForIdentifier("a", {{key, STWValue("G")}}, key), Strings{"G"});
    EXPECT_EQ(M::_copyApplicationGroupEntitlementForIdentifier("a", {{key, strings({"G", "H", "G"})}}, key),
              (Strings{"G", "H"}));
    EXPECT_EQ(M::_copyApplicationGroupEntitlementForIdentifier("a", {{key, strings({})}}, key), Strings{});
    STWValue mixed(STWValue::Array{STWValue("G"), STWValue(5)});
    EXPECT_FALSE(M::_copyApplicationGroupEntitlementForIdentifier("a", {{key, mixed}}, key));
    EXPECT_FALSE(M::_copyApplicationGroupEntitlementForIdentifier("a", {{key, STWValue(5)}}, key));
    EXPECT_FALSE(M::_copyApplicationGroupEntitlementForIdentifier("a", {}, key));

    // System groups: the first key unless it is empty, and only prefixed identifiers for
    // callers, while every identifier counts.
    STWValue::Dictionary system{{STWEntitlementKey::systemGroups, strings({})},
                                {STWEntitlementKey::systemGroupContainers, strings({"systemgroup.a", "plain"})}};
    EXPECT_EQ(M::_systemGroupIdentifiersForIdentifier("s", system), Strings{"systemgroup.a"});
    ASSERT_EQ(process(entitlementsInfo(system), "com.t.system"), STWErrorSuccess);
    auto counts = *mapping->copyReferenceCountSetOfType(STWGroupTypeSystem);
    EXPECT_EQ(counts["plain"], 1);
    // Dropping a system group deletes nothing.
    ASSERT_EQ(process(std::nullopt, "com.t.system"), STWErrorSuccess);
    EXPECT_EQ(queue->count(), 0u);
}

TEST_F(STWCodeSigningMappingTest, AGroupContainerGoesWithItsLastReferenceOrInASweep) {
    auto personal = STWTestPersonalIdentity(), enterprise = STWTestEnterpriseIdentity();
    auto sharedPersonal = STWMakeTestContainer(personal, "G", STWContainerClassSharedAppGroup);
    auto sharedEnterprise = STWMakeTestContainer(enterprise, "G", STWContainerClassSharedAppGroup);
    auto placeholderOnly = STWMakeTestContainer(personal, "G.placeholder", STWContainerClassSharedAppGroup);
    auto invalidOnly = STWMakeTestContainer(personal, "G.invalid", STWContainerClassSharedAppGroup);
    auto orphan = STWMakeTestContainer(personal, "G.orphan", STWContainerClassSharedAppGroup);

    // "G" as a string and as an array reference the same group.
    ASSERT_EQ(process(appGroupsInfo(strings({"G"})), "com.t.one"), STWErrorSuccess);
    ASSERT_EQ(process(appGroupsInfo(STWValue("G")), "com.t.two"), STWErrorSuccess);
    EXPECT_EQ((*mapping->copyReferenceCountSetOfType(STWGroupTypeApplication))["G"], 2);
    // One app drops the group: the other still needs it.
    ASSERT_EQ(process(appGroupsInfo(strings({"H"})), "com.t.one"), STWErrorSuccess);
    completeRequest();
    EXPECT_TRUE(std::filesystem::exists(sharedPersonal.url));
    // The last one goes: the group's container goes for every user that has one.
    ASSERT_EQ(process(std::nullopt, "com.t.two"), STWErrorSuccess);
    completeRequest();
    EXPECT_FALSE(std::filesystem::exists(sharedPersonal.url));
    EXPECT_FALSE(std::filesystem::exists(sharedEnterprise.url));

    // The sweep keeps groups that only a placeholder or an invalid entry names.
    ASSERT_EQ(process(appGroupsInfo(strings({"G.placeholder"})), "com.t.placeholder",
                      {{"com.vorlane.Stowly.PlaceholderEntitlements", STWValue(true)}}),
              STWErrorSuccess);
    ASSERT_EQ(process(appGroupsInfo(strings({"G.invalid"})), "com.t.invalid"), STWErrorSuccess);
    ASSERT_TRUE(mapping->invalidateCodeSigningInfoForIdentifier("com.t.invalid", nullptr));
    STWGroupManager::defaultManager()->reconcileGroupContainersOfType(STWGroupTypeApplication, *queue);
    completeRequest();
    EXPECT_TRUE(std::filesystem::exists(placeholderOnly.url));
    EXPECT_TRUE(std::filesystem::exists(invalidOnly.url));
    EXPECT_FALSE(std::filesystem::exists(orphan.url));

    uint64_t code = STWErrorSuccess;
    EXPECT_FALSE(STWGroupManager::defaultManager()->groupContainerIdentifiersForOwnerIdentifier(
        std::nullopt, STWContainerClassSharedAppGroup, true, &code));
    EXPECT_EQ(code, STWErrorInvalidClass);
}

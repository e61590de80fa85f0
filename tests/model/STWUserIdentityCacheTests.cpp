#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "platform/STWFilePersonaService.h"
#include "tests/support/STWEventLoopThread.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <thread>

namespace {

class STWUserIdentityCacheTest : public ::testing::Test {
protected:
    void SetUp() override {
        STWTestRoot::shared();
        STWUserIdentityCache::setResyncRetryInterval(std::chrono::milliseconds(1));
        STWTestRoot::shared().writePersonas({
            STWTestRoot::persona("PERSONAL", 1000, "personal", {STWValue("com.personal.only")}),
            STWTestRoot::persona("ENT-1", 1001, "enterprise",
                                 {STWValue("com.work.mail"), STWValue("com.both")}, "/private/var/ent1"),
            STWTestRoot::persona("ENT-2", 1002, "enterprise", {STWValue("com.both")}),
            STWTestRoot::persona("UNIVERSAL", 1003, "universal", {STWValue("com.vorlane.shared")}),
            STWTestRoot::persona(nullptr, 1004, "enterprise", {STWValue("com.broken")}),
            // Homes that would not lie below the root prefix.
            STWTestRoot::persona("ENT-3", 1005, "enterprise", {STWValue("com.broken")}, "private/var/ent3"),
            STWTestRoot::persona("ENT-4", 1006, "enterprise", {STWValue("com.broken")}, "/private/../../ent4"),
        });
        cache = STWUserIdentityCache::create();
    }
    std::shared_ptr<STWUserIdentityCache> cache;
};

std::set<std::string> identifiers(const STWUserIdentitySet& set) {
    std::set<std::string> ids;
    for (const auto& identity : set)
        ids.insert(identity->identifier());
    return ids;
}

TEST_F(STWUserIdentityCacheTest, RebuildMapsBundlesToTheIdentitiesThatMayOwnThem) {
    ASSERT_TRUE(STWUserIdentityCache::personasAreSupported());
    EXPECT_EQ(identifiers(cache->userIdentitiesForBundleIdentifier("com.work.mail")), std::set<std::string>{"ENT-1"});
    EXPECT_EQ(identifiers(cache->userIdentitiesForBundleIdentifier("com.both")), (std::set<std::string>{"ENT-1", "ENT-2"}));
    // Universal bundles belong to the personal identity and every enterprise identity.
    EXPECT_EQ(identifiers(cache->userIdentitiesForBundleIdentifier("com.vorlane.shared")),
              (std::set<std::string>{"501", "ENT-1", "ENT-2"}));
    // A bundle no persona lists (or only the personal one lists) is the personal identity's.
    EXPECT_EQ(identifiers(cache->userIdentitiesForBundleIdentifier("com.unknown")), std::set<std::string>{"501"});
    EXPECT_EQ(identifiers(cache->userIdentitiesForBundleIdentifier("com.personal.only")), std::set<std::string>{"501"});
    // The enterprise personas without a unique string or a usable home were skipped.
    EXPECT_EQ(identifiers(cache->userIdentitiesForBundleIdentifier("com.broken")), std::set<std::string>{"501"});

    auto ent1 = cache->userIdentityForPersonaUniqueString(std::string("ENT-1"), 501, 501);
    ASSERT_TRUE(ent1);
    EXPECT_TRUE(ent1->isEnterprise());
    EXPECT_EQ(ent1->homeDirectoryURL(), STWTestRoot::shared().resolve("/private/var/ent1"));
    EXPECT_EQ(ent1->kernelPersonaID(), 1001u);
    EXPECT_TRUE(cache->isBundleIdentifier("com.work.mail", ent1));
    EXPECT_FALSE(cache->isBundleIdentifier("com.work.mail", cache->userIdentityForPersonalPersona()));
    EXPECT_TRUE(cache->userIdentityWithPersonaID(1003)->isNoSpecificPersona());
    EXPECT_EQ(cache->userIdentityWithPersonaID(1000)->personaType(), STWPersonaTypePersonal);
    EXPECT_FALSE(cache->userIdentityWithPersonaID(4242));
    EXPECT_FALSE(cache->userIdentityForCurrentUserWithPersonaUniqueString(std::string("NOPE")));

    std::set<std::string> seen;
    cache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const STWUserIdentityRef& u) { seen.insert(u->identifier()); });
    EXPECT_EQ(seen, (std::set<std::string>{"501", "ENT-1", "ENT-2"}));
}

TEST_F(STWUserIdentityCacheTest, RoleUsersStandForTheMobileUserAndOtherUsersGetTheirOwnHome) {
    for (uid_t uid : {0u, 500u}) {
        auto identity = cache->userIdentityForPersonalPersonaWithUID(uid, uid);
        EXPECT_EQ(identity->posixUID(), 501u) << uid;
        EXPECT_EQ(identity->posixGID(), 501u) << uid;
    }
    auto other = cache->userIdentityForPersonalPersonaWithUID(502, 502);
    EXPECT_EQ(other->posixUID(), 502u);
    // User 502's home does not exist under the root, so the mobile home stands in.
    EXPECT_EQ(other->homeDirectoryURL(), STWTestRoot::shared().resolve("/private/var/mobile"));
    auto enterprise = cache->userIdentityForPersonaUniqueString(std::string("ENT-1"), 502, 502);
    EXPECT_EQ(enterprise->homeDirectoryURL(), STWTestRoot::shared().resolve("/private/var/ent1")); // keeps its own home
}

TEST_F(STWUserIdentityCacheTest, CurrentContextFollowsTheCallersPersona) {
    {
        STWPersonaContext context(std::string("ENT-2"));
        EXPECT_EQ(cache->userIdentityForCurrentContextWithUID(501, 501)->identifier(), "ENT-2");
    }
    {
        STWPersonaContext context(std::string("PERSONAL"));
        EXPECT_EQ(cache->userIdentityForCurrentContextWithUID(501, 501)->personaType(), STWPersonaTypePersonal);
    }
    EXPECT_TRUE(cache->userIdentityForCurrentContextWithUID(501, 501)->isNoSpecificPersona());
}

TEST_F(STWUserIdentityCacheTest, StoredFormsOfBothVersions) {
    uint64_t error = 1;
    auto v2 = STWUserIdentity::userIdentityWithPlist(STWValue(cache->userIdentityForPersonaUniqueString(std::string("ENT-1"), 501, 501)->plist()),
                                                     *cache, &error);
    ASSERT_TRUE(v2);
    EXPECT_EQ(v2->identifier(), "ENT-1");
    EXPECT_EQ(error, 1u);

    STWValue::Dictionary typeThree{{"posixUID", STWValue(501)}, {"posixGID", STWValue(501)}, {"type", STWValue(3)}, {"version", STWValue("2")}};
    EXPECT_FALSE(STWUserIdentity::userIdentityWithPlist(STWValue(typeThree), *cache, &error));
    EXPECT_EQ(error, 75u);

    error = 1;
    STWValue::Dictionary enterpriseWithoutString{{"posixUID", STWValue(501)}, {"posixGID", STWValue(501)}, {"type", STWValue(1)}, {"version", STWValue("2")}};
    auto personal = STWUserIdentity::userIdentityWithPlist(STWValue(enterpriseWithoutString), *cache, &error);
    ASSERT_TRUE(personal);
    EXPECT_EQ(personal->personaType(), STWPersonaTypePersonal);

    STWValue::Dictionary stringUID{{"posixUID", STWValue("501")}, {"posixGID", STWValue(501)}, {"version", STWValue("1")}};
    EXPECT_FALSE(STWUserIdentity::userIdentityWithPlist(STWValue(stringUID), *cache, &error));
    EXPECT_EQ(error, 75u);

    error = 1;
    STWValue::Dictionary v1{{"posixUID", STWValue(501)}, {"posixGID", STWValue(501)}, {"personaIdentifier", STWValue("ENT-2")}, {"version", STWValue("1")}};
    EXPECT_EQ(STWUserIdentity::userIdentityWithPlist(STWValue(v1), *cache, &error)->identifier(), "ENT-2");

    // Well-formed but unknown to the cache: no identity, and the code stays 1.
    error = 1;
    STWValue::Dictionary unknown{{"posixUID", STWValue(501)}, {"posixGID", STWValue(501)}, {"type", STWValue(1)},
                                 {"personaUniqueString", STWValue("GONE")}, {"version", STWValue("2")}};
    EXPECT_FALSE(STWUserIdentity::userIdentityWithPlist(STWValue(unknown), *cache, &error));
    EXPECT_EQ(error, 1u);
    EXPECT_FALSE(STWUserIdentity::userIdentityWithPlist(STWValue(STWValue::Array{}), *cache, &error));
}

TEST_F(STWUserIdentityCacheTest, APersonaChangeIsNoticedAndApplied) {
    ASSERT_FALSE(cache->userIdentityForCurrentUserWithPersonaUniqueString(std::string("ENT-NEW")));
    STWEventLoopThread loop;
    STWTestRoot::shared().writePersonas({
        STWTestRoot::persona("PERSONAL", 1000, "personal"),
        STWTestRoot::persona("ENT-NEW", 1010, "enterprise", {STWValue("com.new")}),
    });
    // The change arrives through the file watcher, on the event loop, and the flush queue.
    STWUserIdentityRef found;
    for (int i = 0; i < 500 && !found; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
        found = cache->userIdentityForCurrentUserWithPersonaUniqueString(std::string("ENT-NEW"));
    }
    ASSERT_TRUE(found);
    EXPECT_TRUE(cache->isRegistered());
    EXPECT_EQ(identifiers(cache->userIdentitiesForBundleIdentifier("com.new")), std::set<std::string>{"ENT-NEW"});
    EXPECT_FALSE(cache->userIdentityForCurrentUserWithPersonaUniqueString(std::string("ENT-1")));
}

// Repopulated from identities, the cache invents the unspecific one; with no persona but the
// default one it still visits that identity, once.
TEST_F(STWUserIdentityCacheTest, RepopulatingFromIdentities) {
    auto home = STWTestRoot::shared().resolve("/private/var/mobile");
    auto personal = STWUserIdentity::initWithUID(501, 501, home, "X", STWPersonaTypePersonal, 7);
    auto enterprise = STWUserIdentity::initWithUID(501, 501, home, "E", STWPersonaTypeEnterprise, 8);
    cache->flushAndRepopulateWithUserIdentities({personal, enterprise});
    EXPECT_FALSE(cache->cacheInvalid());
    auto unspecific = cache->unspecificUserIdentity();
    EXPECT_TRUE(unspecific->isNoSpecificPersona());
    EXPECT_EQ(unspecific->kernelPersonaID(), 7u);
    EXPECT_EQ(cache->userIdentityWithPersonaID(8)->identifier(), "E");

    cache->flushAndRepopulateWithUserIdentities(
        {STWUserIdentity::initWithUID(501, 501, home, std::nullopt, STWPersonaTypePersonal, 501)});
    std::vector<STWUserIdentityRef> visited;
    cache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        [&](const STWUserIdentityRef& identity) { visited.push_back(identity); });
    ASSERT_EQ(visited.size(), 1u);
    EXPECT_EQ(visited[0], STWUserIdentityCache::defaultUserIdentity());
}

TEST_F(STWUserIdentityCacheTest, AListWithoutAPersonalPersonaIsRetriedUntilItHasOne) {
    STWEventLoopThread loop; // the persona service hears of the fix through its watch
    STWUserIdentityCache::setResyncRetryInterval(std::chrono::milliseconds(20));
    STWTestRoot::shared().writePersonas(
        {STWTestRoot::persona("ENT-ONLY", 1020, "enterprise", {STWValue("com.only")})});
    cache->flush();
    // The rebuild keeps failing, holding the lock, until the list is fixed behind its back.
    auto fixer = std::async(std::launch::async, [] {
        std::this_thread::sleep_for(std::chrono::milliseconds(150));
        STWTestRoot::shared().writePersonas({
            STWTestRoot::persona("PERSONAL", 1000, "personal"),
            STWTestRoot::persona("ENT-ONLY", 1020, "enterprise", {STWValue("com.only")}),
        });
    });
    auto identities = cache->userIdentitiesForBundleIdentifier("com.only");
    fixer.get();
    EXPECT_EQ(identifiers(identities), std::set<std::string>{"ENT-ONLY"});
    EXPECT_EQ(cache->userIdentityWithPersonaID(1000)->personaType(), STWPersonaTypePersonal);
}

TEST_F(STWUserIdentityCacheTest, ExhaustedRetriesStopTheDaemon) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(
        {
            STWTestRoot::shared().writePersonas({});
            cache->flush();
            cache->userIdentityForPersonalPersona();
        },
        "Could not obtain persona attributes after exhausting retries\\.");
}

TEST_F(STWUserIdentityCacheTest, AnUnregisteredCacheKeepsWhatItHas) {
    ASSERT_TRUE(cache->userIdentityForCurrentUserWithPersonaUniqueString(std::string("ENT-1")));
    STWEventLoopThread loop;
    cache->unregister();
    EXPECT_FALSE(cache->isRegistered());
    STWTestRoot::shared().writePersonas({STWTestRoot::persona("PERSONAL", 1000, "personal")});
    // A registered cache applies such a change within a few milliseconds (see above).
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    EXPECT_FALSE(cache->cacheInvalid());
    EXPECT_TRUE(cache->userIdentityForCurrentUserWithPersonaUniqueString(std::string("ENT-1")));
}

} // namespace

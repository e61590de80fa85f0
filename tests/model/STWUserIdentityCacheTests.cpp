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
        // A service of its own: one an earlier test of the process used keeps the list it read
        // until its watch, which needs the event loop, reports the file changed.
        STWPersonaService::setSharedInstance(std::make_shared<STWFilePersonaService>());
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

TEST_F(STWUserIdentityCacheTest, RoleUsersOtherUsersAndTheCurrentContext) {
    for (uid_t uid : {0u, 500u}) {
        auto identity = cache->userIdentityForPersonalPersonaWithUID(uid, uid);
        EXPECT_EQ(identity->posixUID(), 501u) << uid;
        EXPECT_EQ(identity->posixGID(), 501u) << uid;
    }
    auto other = cache->userIdentityForPersonalPersonaWithUID(502, 502);
    EXPECT_EQ(other->posixUID(), 502u);
    // User 502's home does not exist under the root, so the mobile home stands in.
    EXPECT_EQ(other->homeDirectoryURL(), STWTestRoot::shared().resolve("/private/var/mobile"));
    // An enterprise identity keeps its own home.
    auto enterprise = cache->userIdentityForPersonaUniqueString(std::string("ENT-1"), 502, 502);
    EXPECT_EQ(enterprise->homeDirectoryURL(), STWTestRoot::shared().resolve("/private/var/ent1"));

    // The current context follows the caller's persona.
    {
        STWPersonaContext context(std::string("ENT-2"));
        EXPECT_EQ(cache->userIdentityForCurrentContextWithUID(501, 501)->identifier(), "ENT-2");
    }
    EXPECT_TRUE(cache->userIdentityForCurrentContextWithUID(501, 501)->isNoSpecificPersona());
}

// Well-formed but unknown to the cache gives no identity and leaves the code alone.
TEST_F(STWUserIdentityCacheTest, StoredFormsOfBothVersions) {
    using D = STWValue::Dictionary;
    const D ids{{"posixUID", STWValue(501)}, {"posixGID", STWValue(501)}};
    auto with = [&](D extra) {
        extra.insert(ids.begin(), ids.end());
        return STWValue(extra);
    };
    const struct {
        STWValue plist;
        const char* identifier; // "": none
        uint64_t code;
    } cases[] = {
        {STWValue(cache->userIdentityForPersonaUniqueString(std::string("ENT-1"), 501, 501)->plist()),
         "ENT-1", 1},
        {with({{"type", STWValue(3)}, {"version", STWValue("2")}}), "", 75},
        {with({{"type", STWValue(1)}, {"version", STWValue("2")}}), "501", 1}, // enterprise without a string
        {STWValue(D{{"posixUID", STWValue("501")}, {"posixGID", STWValue(501)}, {"version", STWValue("1")}}),
         "", 75},
        {with({{"personaIdentifier", STWValue("ENT-2")}, {"version", STWValue("1")}}), "ENT-2", 1},
        {with({{"type", STWValue(1)}, {"personaUniqueString", STWValue("GONE")}, {"version", STWValue("2")}}),
         "", 1},
        {STWValue(STWValue::Array{}), "", 75},
    };
    for (const auto& c : cases) {
        uint64_t error = 1;
        auto identity = STWUserIdentity::userIdentityWithPlist(c.plist, *cache, &error);
        EXPECT_EQ(identity ? identity->identifier() : "", c.identifier) << c.plist.description();
        EXPECT_EQ(error, c.code) << c.plist.description();
    }
}

// The change arrives through the file watcher, on the event loop, and the flush queue; a
// cache that unregistered keeps what it had.
TEST_F(STWUserIdentityCacheTest, APersonaChangeIsAppliedByARegisteredCacheOnly) {
    auto unregistered = STWUserIdentityCache::create();
    ASSERT_TRUE(unregistered->userIdentityForCurrentUserWithPersonaUniqueString(std::string("ENT-1")));
    unregistered->unregister();
    EXPECT_FALSE(unregistered->isRegistered());
    ASSERT_FALSE(cache->userIdentityForCurrentUserWithPersonaUniqueString(std::string("ENT-NEW")));
    STWEventLoopThread loop;
    STWTestRoot::shared().writePersonas({
        STWTestRoot::persona("PERSONAL", 1000, "personal"),
        STWTestRoot::persona("ENT-NEW", 1010, "enterprise", {STWValue("com.new")}),
    });
    STWUserIdentityRef found;
    for (int i = 0; i < 500 && !found; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
        found = cache->userIdentityForCurrentUserWithPersonaUniqueString(std::string("ENT-NEW"));
    }
    ASSERT_TRUE(found);
    EXPECT_TRUE(cache->isRegistered());
    EXPECT_EQ(identifiers(cache->userIdentitiesForBundleIdentifier("com.new")), std::set<std::string>{"ENT-NEW"});
    EXPECT_FALSE(cache->userIdentityForCurrentUserWithPersonaUniqueString(std::string("ENT-1")));
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    EXPECT_FALSE(unregistered->cacheInvalid());
    EXPECT_TRUE(unregistered->userIdentityForCurrentUserWithPersonaUniqueString(std::string("ENT-1")));
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

} // namespace

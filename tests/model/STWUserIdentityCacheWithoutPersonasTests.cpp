// The persona cache on a device without personas: a program of its own, since persona
// support is decided once per process.
#include "Daemon/Model/STWUserIdentityCache.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

namespace {

class STWUserIdentityCacheWithoutPersonasTest : public ::testing::Test {
protected:
    void SetUp() override {
        STWTestRoot::shared().writeSettings({{"PersonasUnsupported", STWValue(true)}});
        // A persona list that would give other answers if it were consulted.
        STWTestRoot::shared().writePersonas(
            {STWTestRoot::persona("ENT", 1100, "enterprise", {STWValue("com.work")})});
        cache = STWUserIdentityCache::create();
        home = STWTestRoot::shared().resolve("/private/var/mobile");
    }
    std::shared_ptr<STWUserIdentityCache> cache;
    std::filesystem::path home;
};

TEST_F(STWUserIdentityCacheWithoutPersonasTest, EveryQueryAnswersWithThePersonalIdentity) {
    ASSERT_FALSE(STWUserIdentityCache::personasAreSupported());
    auto enterprise = STWUserIdentity::initWithUID(501, 501, home, "ENT", STWPersonaTypeEnterprise, 1100);
    EXPECT_TRUE(cache->isBundleIdentifier("com.work", enterprise));
    EXPECT_TRUE(cache->isBundleIdentifier("com.anything", enterprise));

    std::vector<STWUserIdentityRef> visited;
    cache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        [&](const STWUserIdentityRef& identity) { visited.push_back(identity); });
    ASSERT_EQ(visited.size(), 1u);
    EXPECT_EQ(visited[0], STWUserIdentityCache::defaultUserIdentity());

    auto byString = cache->userIdentityForPersonaUniqueString(std::string("ENT"), 0, 0);
    ASSERT_TRUE(byString);
    EXPECT_EQ(byString->personaType(), STWPersonaTypePersonal);
    EXPECT_EQ(byString->posixUID(), 501u);
    EXPECT_EQ(cache->userIdentityForCurrentUserWithPersonaUniqueString(std::string("ENT"))->personaType(),
              STWPersonaTypePersonal);
    {
        STWPersonaContext context(std::string("ENT"));
        EXPECT_EQ(cache->userIdentityForCurrentContextWithUID(502, 502)->identifier(), "502");
    }
    EXPECT_FALSE(cache->userIdentityWithPersonaID(1100));
    EXPECT_FALSE(cache->cacheInvalid());
}

} // namespace

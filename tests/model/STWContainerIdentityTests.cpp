#include "Daemon/Model/STWConcreteContainerIdentity.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <unordered_map>

namespace {

class STWContainerIdentityTest : public ::testing::Test {
protected:
    void SetUp() override {
        STWTestRoot::shared();
        home = STWTestRoot::shared().resolve("/private/var/mobile");
        personal = STWUserIdentity::initWithUID(501, 501, home, "P", STWPersonaTypePersonal, 501);
        unspecific = STWUserIdentity::initWithUID(501, 501, home, "P", STWPersonaTypeUnspecific, 501);
        enterpriseA = STWUserIdentity::initWithUID(501, 501, home, "ENT-A", STWPersonaTypeEnterprise, 1001);
        enterpriseB = STWUserIdentity::initWithUID(501, 501, home, "ENT-B", STWPersonaTypeEnterprise, 1002);
    }
    std::filesystem::path home;
    STWUserIdentityRef personal, unspecific, enterpriseA, enterpriseB;
};

TEST_F(STWContainerIdentityTest, ClassBoundariesAndMissingPartsGiveTheirCodes) {
    for (STWContainerClass c : {0ull, 14ull, 15ull, 1ull << 63}) {
        uint64_t error = 1;
        EXPECT_FALSE(STWContainerIdentity::containerIdentityWithUserIdentity(personal, "a.b", c, &error)) << c;
        EXPECT_EQ(error, 11u) << c;
    }
    for (STWContainerClass c = 1; c <= 13; ++c) {
        uint64_t error = 1;
        EXPECT_TRUE(STWContainerIdentity::containerIdentityWithUserIdentity(personal, "a.b", c, &error)) << c;
        EXPECT_EQ(error, 1u);
    }
    uint64_t error = 1;
    EXPECT_FALSE(STWContainerIdentity::containerIdentityWithUserIdentity(personal, STWValue(), 2, &error));
    EXPECT_EQ(error, 18u);
    error = 1;
    EXPECT_FALSE(STWContainerIdentity::containerIdentityWithUserIdentity(personal, STWValue(7), 2, &error));
    EXPECT_EQ(error, 11u);
    error = 1;
    EXPECT_FALSE(STWContainerIdentity::containerIdentityWithUserIdentity(nullptr, "a.b", 2, &error));
    EXPECT_EQ(error, 11u);
    // The concrete identity checks the base fields; every UUID is one, the all-zero one too.
    error = 1;
    EXPECT_FALSE(STWConcreteContainerIdentity::containerIdentityWithUUID(STWUUID{}, personal, STWValue(), 2, &error));
    EXPECT_EQ(error, 18u);
    EXPECT_TRUE(STWConcreteContainerIdentity::containerIdentityWithUUID(STWUUID{}, personal, "a.b", 2, nullptr));

    for (STWContainerClass c = 0; c <= 15; ++c) {
        error = 1;
        bool global = c == 1 || c == 3 || c == 5 || c == 8 || c == 12 || c == 13;
        auto identity = STWContainerIdentity::containerIdentityWithIdentifier("a.b", c, &error);
        EXPECT_EQ(identity != nullptr, global) << c;
        EXPECT_EQ(error, global ? 1u : 11u) << c;
        if (identity) {
            EXPECT_EQ(*identity->userIdentity(), *STWUserIdentityCache::defaultUserIdentity());
        }
    }
}

TEST_F(STWContainerIdentityTest, EqualityFollowsTheUserIdentityIdentifier) {
    EXPECT_EQ(personal->identifier(), "501");
    EXPECT_EQ(enterpriseA->identifier(), "ENT-A");
    EXPECT_EQ(*personal, *unspecific);
    EXPECT_FALSE(*enterpriseA == *enterpriseB);
    EXPECT_FALSE(*personal == *enterpriseA);
    EXPECT_FALSE(STWUserIdentity::initWithUID(500, 500, home, std::nullopt, 0, 500)); // role users are refused

    auto a = STWContainerIdentity::containerIdentityWithUserIdentity(personal, "com.x", 2, nullptr);
    auto b = STWContainerIdentity::containerIdentityWithUserIdentity(unspecific, "com.x", 2, nullptr);
    auto otherClass = STWContainerIdentity::containerIdentityWithUserIdentity(personal, "com.x", 4, nullptr);
    auto enterprise = STWContainerIdentity::containerIdentityWithUserIdentity(enterpriseA, "com.x", 2, nullptr);
    EXPECT_TRUE(a->isEqual(*b));
    EXPECT_EQ(a->hash(), b->hash());
    EXPECT_FALSE(a->isEqual(*otherClass));
    EXPECT_FALSE(a->isEqual(*enterprise));

    STWUUID uuid = STWUUID::random();
    auto concrete = STWConcreteContainerIdentity::containerIdentityWithUUID(uuid, personal, "com.x", 2, nullptr);
    auto concreteOther = STWConcreteContainerIdentity::containerIdentityWithUUID(STWUUID::random(), personal, "com.x", 2, nullptr);
    EXPECT_TRUE(a->isEqual(*concrete));         // the plain identity ignores the UUID
    EXPECT_FALSE(concrete->isEqual(*a));        // the concrete one never equals a plain one
    EXPECT_FALSE(concrete->isEqual(*concreteOther));
    EXPECT_TRUE(concrete->isEqual(*STWConcreteContainerIdentity::containerIdentityWithUUID(uuid, unspecific, "com.x", 2, nullptr)));

    std::unordered_map<STWContainerIdentityRef, int, STWContainerIdentityRefHash, STWContainerIdentityRefEqual> map;
    map[a] = 1;
    map[b] = 2;
    map[enterprise] = 3;
    EXPECT_EQ(map.size(), 2u);
    EXPECT_EQ(map[a], 2);
}

TEST_F(STWContainerIdentityTest, DescriptionsAndStoredForm) {
    auto identity = STWContainerIdentity::containerIdentityWithUserIdentity(enterpriseA, "com.x", 9, nullptr);
    std::string text = identity->description();
    EXPECT_EQ(text.rfind("<STWContainerIdentity: 0x", 0), 0u) << text;
    EXPECT_NE(text.find("/501/ENT-A/1/1001>, identifier = com.x, class = 9>"), std::string::npos) << text;
    EXPECT_EQ(STWValue(enterpriseA->plist()).description(),
              "{ \"personaUniqueString\" = \"ENT-A\"; \"posixGID\" = 501; \"posixUID\" = 501; \"type\" = 1; \"version\" = \"2\"; }");
    EXPECT_NE(personal->description().find("personaType = personal, personaUniqueString = P, kernelPersonaID = 501>"),
              std::string::npos);
}

} // namespace

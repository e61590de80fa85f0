#include "Daemon/Model/STWConcreteContainerIdentity.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

namespace {

class STWContainerIdentityTest : public ::testing::Test {
protected:
    void SetUp() override {
        home = STWTestRoot::shared().resolve("/private/var/mobile");
        personal = STWUserIdentity::initWithUID(501, 501, home, "P", STWPersonaTypePersonal, 501);
        unspecific = STWUserIdentity::initWithUID(501, 501, home, "P", STWPersonaTypeUnspecific, 501);
        enterpriseA = STWUserIdentity::initWithUID(501, 501, home, "ENT-A", STWPersonaTypeEnterprise, 1001);
        enterpriseB = STWUserIdentity::initWithUID(501, 501, home, "ENT-B", STWPersonaTypeEnterprise, 1002);
    }
    std::filesystem::path home;
    STWUserIdentityRef personal, unspecific, enterpriseA, enterpriseB;
};

// The code a factory leaves in its error argument (1 when it succeeds).
template <typename Make>
uint64_t codeOf(Make make) {
    uint64_t error = 1;
    bool made = make(&error) != nullptr;
    EXPECT_EQ(made, error == 1) << error;
    return error;
}

// Classes 0 and 14 and a missing identifier are answered over the socket in the end-to-end
// tests; here the other ways a factory refuses.
TEST_F(STWContainerIdentityTest, ClassBoundariesAndMissingPartsGiveTheirCodes) {
    auto withUser = [&](const STWUserIdentityRef& user, STWValue identifier, STWContainerClass c) {
        return codeOf([&](uint64_t* e) { return STWContainerIdentity::containerIdentityWithUserIdentity(user, identifier, c, e); });
    };
    EXPECT_EQ(withUser(personal, "a.b", 1ull << 63), 11u);
    EXPECT_EQ(withUser(personal, "a.b", 13), 1u);
    EXPECT_EQ(withUser(personal, STWValue(7), 2), 11u);
    EXPECT_EQ(withUser(nullptr, "a.b", 2), 11u);
    // The concrete identity checks the base fields; every UUID is one, the all-zero one too.
    auto concrete = [&](uint64_t* e) {
        return STWConcreteContainerIdentity::containerIdentityWithUUID(STWUUID{}, personal, STWValue(), 2, e);
    };
    EXPECT_EQ(codeOf(concrete), 18u);

    // Without a user identity only the global classes can be named; they get the default user.
    auto withoutUser = [](STWContainerClass c) {
        return codeOf(
            [&](uint64_t* e) { return STWContainerIdentity::containerIdentityWithIdentifier("a.b", c, e); });
    };
    EXPECT_EQ(withoutUser(12), 1u);
    EXPECT_EQ(withoutUser(2), 11u);
    EXPECT_EQ(*STWContainerIdentity::containerIdentityWithIdentifier("a.b", 12, nullptr)->userIdentity(),
              *STWUserIdentityCache::defaultUserIdentity());
}

TEST_F(STWContainerIdentityTest, EqualityFollowsTheUserIdentityIdentifier) {
    EXPECT_EQ(*personal, *unspecific);
    EXPECT_FALSE(*enterpriseA == *enterpriseB);
    EXPECT_FALSE(*personal == *enterpriseA);
    EXPECT_FALSE(STWUserIdentity::initWithUID(500, 500, home, std::nullopt, 0, 500)); // role users are refused
    // The stored form inside every metadata file.
    EXPECT_EQ(STWValue(enterpriseA->plist()).description(), "{ \"personaUniqueString\" = \"ENT-A\"; \"posixGID\" = 501; "
                                                           "\"posixUID\" = 501; \"type\" = 1; \"version\" = \"2\"; }");

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
    EXPECT_TRUE(concrete->isEqual(
        *STWConcreteContainerIdentity::containerIdentityWithUUID(uuid, unspecific, "com.x", 2, nullptr)));
}

} // namespace

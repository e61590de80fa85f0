#include "Daemon/Request/STWRequestDispatcher.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

namespace {

STWClientIdentityRef caller(STWValue::Dictionary entitlements) {
    return STWClientIdentity::initWithBundleIdentifier("com.example.caller", 501, 501, 4242,
                                                       STWUserIdentityCache::defaultUserIdentity(),
                                                       std::move(entitlements), false, STWAuditToken{});
}

std::shared_ptr<STWClientConnection> decide(uint64_t command, const STWClientIdentityRef& identity) {
    return STWRequestDispatcher::checkEntitlementsAndInitClientObject(STWCommandTable[command], identity,
                                                                      STWCommandQueue::init());
}

// Commands for which a caller gets a connection.
std::vector<uint64_t> connectedCommands(const STWClientIdentityRef& identity) {
    std::vector<uint64_t> commands;
    for (uint64_t c = 0; c < STWCommandCount; c++)
        if (decide(c, identity))
            commands.push_back(c);
    return commands;
}

const STWValue::Dictionary lookupOnly{
    {"com.vorlane.private.Stowly.lookup",
     STWValue(STWValue::Dictionary{{"appData", STWValue(STWValue::Array{STWValue("com.other.app")})}})}};

class STWEntitlementDecisionTest : public ::testing::Test {
protected:
    void SetUp() override { STWTestRoot::shared(); }
};

} // namespace

TEST_F(STWEntitlementDecisionTest, CallersWithoutEntitlementsOnlyReachTheOpenCommands) {
    // The dispatcher finds a command's row by its number.
    for (uint64_t c = 0; c < STWCommandCount; c++)
        EXPECT_EQ(STWCommandTable[c].command, c);
    std::vector<uint64_t> open{0, 13, 15, 16, 17, 28};
    EXPECT_EQ(connectedCommands(caller({})), open);
    // No identity at all (no signing identifier): the same commands, with no client.
    EXPECT_EQ(connectedCommands(nullptr), open);
    auto connection = decide(0, caller({}));
    EXPECT_FALSE(connection->entitled() || connection->unrestricted());
    EXPECT_EQ(connection->clientBundleIdentifier().value_or(""), "com.example.caller");
    EXPECT_FALSE(decide(0, nullptr)->clientBundleIdentifier().has_value());
}

TEST_F(STWEntitlementDecisionTest, AllowedIsUnrestrictedExceptWhereTestabilityIsRequired) {
    auto allowed = caller({{"com.vorlane.private.Stowly.allowed", STWValue(true)}});
    for (uint64_t c = 0; c < STWCommandCount; c++) {
        auto connection = decide(c, allowed);
        if (c == 25 || c == 31) {
            EXPECT_EQ(connection, nullptr) << "command " << c;
            continue;
        }
        ASSERT_NE(connection, nullptr) << "command " << c;
        EXPECT_TRUE(connection->entitled() && connection->unrestricted() && connection->allowOtherIdLookup()) << c;
        EXPECT_FALSE(connection->lookup().has_value());
    }
    auto both = caller({{"com.vorlane.private.Stowly.allowed", STWValue(true)},
                        {"com.vorlane.private.Stowly.testability", STWValue(true)}});
    auto testLock = decide(31, both);
    ASSERT_NE(testLock, nullptr);
    EXPECT_TRUE(testLock->entitled());
    EXPECT_FALSE(testLock->unrestricted());
}

TEST_F(STWEntitlementDecisionTest, LookupDictionaryOpensOnlyTheLookupCommands) {
    auto identity = caller(lookupOnly);
    EXPECT_EQ(connectedCommands(identity), (std::vector<uint64_t>{0, 1, 13, 14, 15, 16, 17, 23, 28}));
    auto connection = decide(1, identity);
    EXPECT_FALSE(connection->entitled());
    ASSERT_TRUE(connection->lookup().has_value());
    EXPECT_TRUE(connection->isEntitledForLookupWithClass(2, "com.other.app"));
    EXPECT_FALSE(connection->isEntitledForLookupWithClass(4, "com.other.app"));
    // Command 28 admits anyone but never reads the lookup entitlement.
    EXPECT_FALSE(decide(28, identity)->lookup().has_value());

    // A lookup value that is not a dictionary is no lookup entitlement.
    auto malformed = caller({{"com.vorlane.private.Stowly.lookup", STWValue(STWValue::Array{STWValue("x")})}});
    EXPECT_EQ(connectedCommands(malformed), (std::vector<uint64_t>{0, 13, 15, 16, 17, 28}));
    EXPECT_FALSE(decide(0, malformed)->lookup().has_value());
}

TEST_F(STWEntitlementDecisionTest, OtherIdLookupAndSpecificEntitlements) {
    auto identity = caller({{"com.vorlane.private.Stowly.otherIdLookup", STWValue(1)},
                            {"com.vorlane.private.Stowly.userManagedAssets", STWValue(true)},
                            {"com.vorlane.private.Stowly.dataMigration", STWValue("true")}});
    auto assets = decide(29, identity);
    ASSERT_NE(assets, nullptr);
    EXPECT_TRUE(assets->entitled() && assets->allowOtherIdLookup());
    EXPECT_FALSE(assets->unrestricted());
    EXPECT_NE(decide(4, identity), nullptr);
    // A string is not a boolean entitlement.
    EXPECT_EQ(decide(24, identity), nullptr);
    EXPECT_EQ(decide(2, identity), nullptr);
}

TEST_F(STWEntitlementDecisionTest, WipeContainerArrayEntitlesOnItsOwn) {
    auto wiper = caller({{"com.vorlane.private.Stowly.wipeContainer",
                          STWValue(STWValue::Array{STWValue("com.example.plugin")})}});
    auto connection = decide(11, wiper);
    ASSERT_NE(connection, nullptr);
    EXPECT_TRUE(connection->entitled());
    EXPECT_FALSE(connection->unrestricted());
    EXPECT_EQ(connection->entitledWipeIdentifiers().value_or(STWValue::Array()).size(), 1u);
    // The array alone opens nothing else.
    EXPECT_EQ(decide(10, wiper), nullptr);

    // Allowed without the array: entitled as unrestricted, no identifiers.
    auto allowed = decide(11, caller({{"com.vorlane.private.Stowly.allowed", STWValue(true)}}));
    ASSERT_NE(allowed, nullptr);
    EXPECT_TRUE(allowed->entitled() && !allowed->entitledWipeIdentifiers());
    // A boolean wipeContainer entitlement is not an array.
    EXPECT_EQ(decide(11, caller({{"com.vorlane.private.Stowly.wipeContainer", STWValue(true)}})), nullptr);
}

TEST_F(STWEntitlementDecisionTest, SanitisedLookupDropsWhatIsNotAStringList) {
    auto identity = caller({{"com.vorlane.private.Stowly.lookup",
                             STWValue(STWValue::Dictionary{
                                 {"appGroup", STWValue("group.single.string")},
                                 {"systemGroup", STWValue(STWValue::Array{STWValue("systemgroup.a"), STWValue(7)})},
                             })}});
    auto connection = decide(13, identity);
    EXPECT_FALSE(connection->isEntitledForLookupWithClass(7, "group.single.string"));
    EXPECT_TRUE(connection->isEntitledForLookupWithClass(13, "systemgroup.a"));
    EXPECT_EQ(connection->_lookupForContainerClass(13)->size(), 1u);
    // Classes without a word are never covered.
    EXPECT_FALSE(connection->_lookupForContainerClass(0).has_value());
    EXPECT_FALSE(connection->_lookupForContainerClass(14).has_value());
}

// Command numbers outside the table and unentitled callers are answered in the end-to-end tests.
TEST_F(STWEntitlementDecisionTest, DispatchAnswersWhatFailsEarlyAndTreatsAMissingCommandAsZero) {
    auto reply = std::make_shared<STWReply>(nullptr, 1);
    // A command that fails before its asynchronous part is answered by the dispatcher.
    uint64_t error = 1;
    auto allowed = caller({{"com.vorlane.private.Stowly.allowed", STWValue(true)}});
    EXPECT_TRUE(STWRequestDispatcher::dispatch({{"Command", STWValue(21)}}, reply, allowed, &error));
    EXPECT_NE(error, STWErrorSuccess);

    // Without "Command" (or with a mistyped one) the request is command 0, which admits
    // an unentitled caller: it is not refused.
    for (STWValue::Dictionary request : {STWValue::Dictionary{}, STWValue::Dictionary{{"Command", STWValue("2")}}}) {
        error = 1;
        STWRequestDispatcher::dispatch(request, reply, caller({}), &error);
        EXPECT_NE(error, STWErrorNotEntitled);
    }
}

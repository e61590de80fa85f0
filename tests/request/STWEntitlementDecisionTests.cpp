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

class STWEntitlementDecisionTest : public ::testing::Test {
protected:
    void SetUp() override { STWTestRoot::shared(); }
};

} // namespace

// Callers a client cannot present over the socket, and what each kind of connection may do.
TEST_F(STWEntitlementDecisionTest, CallersWithoutUsableEntitlementsAndAllowedCallers) {
    std::vector<uint64_t> open = connectedCommands(caller({}));
    EXPECT_EQ(connectedCommands(nullptr), open) << "no signing identifier";
    // A lookup that is no dictionary, a string for a boolean, a boolean for an array.
    EXPECT_EQ(connectedCommands(caller({{"com.vorlane.private.Stowly.lookup", STWValue(STWValue::Array{})},
                                        {"com.vorlane.private.Stowly.dataMigration", STWValue("true")},
                                        {"com.vorlane.private.Stowly.wipeContainer", STWValue(true)}})),
              open);
    auto plain = decide(0, caller({}));
    EXPECT_FALSE(plain->entitled() || plain->unrestricted() || plain->lookup());
    EXPECT_EQ(plain->clientBundleIdentifier().value_or(""), "com.example.caller");
    EXPECT_FALSE(decide(0, nullptr)->clientBundleIdentifier().has_value());

    // Allowed is unrestricted except where testability is required.
    auto allowed = caller({{"com.vorlane.private.Stowly.allowed", STWValue(true)}});
    for (uint64_t c = 0; c < STWCommandCount; c++) {
        if (auto connection = decide(c, allowed)) {
            EXPECT_TRUE(connection->entitled() && connection->unrestricted()) << c;
            EXPECT_TRUE(connection->allowOtherIdLookup()) << c;
            EXPECT_FALSE(connection->lookup().has_value()) << c;
        }
    }
    auto both = caller({{"com.vorlane.private.Stowly.allowed", STWValue(true)},
                        {"com.vorlane.private.Stowly.testability", STWValue(true)}});
    auto testLock = decide(31, both);
    ASSERT_NE(testLock, nullptr);
    EXPECT_TRUE(testLock->entitled());
    EXPECT_FALSE(testLock->unrestricted());
}

// Only lists of strings in the lookup dictionary count; classes without a word are never covered.
TEST_F(STWEntitlementDecisionTest, LookupDictionaryEntitlesLookupsOfWhatItNames) {
    using A = STWValue::Array;
    auto identity = caller({{"com.vorlane.private.Stowly.lookup",
                             STWValue(STWValue::Dictionary{
                                 {"appData", STWValue(A{STWValue("com.other.app")})},
                                 {"appGroup", STWValue("group.single.string")},
                                 {"systemGroup", STWValue(A{STWValue("systemgroup.a"), STWValue(7)})},
                             })}});
    auto connection = decide(1, identity);
    EXPECT_FALSE(connection->entitled());
    ASSERT_TRUE(connection->lookup().has_value());
    EXPECT_TRUE(connection->isEntitledForLookupWithClass(2, "com.other.app"));
    EXPECT_FALSE(connection->isEntitledForLookupWithClass(4, "com.other.app"));
    EXPECT_FALSE(connection->isEntitledForLookupWithClass(7, "group.single.string"));
    EXPECT_TRUE(connection->isEntitledForLookupWithClass(13, "systemgroup.a"));
    EXPECT_EQ(connection->_lookupForContainerClass(13)->size(), 1u);
    EXPECT_FALSE(connection->_lookupForContainerClass(0).has_value());
    EXPECT_FALSE(connection->_lookupForContainerClass(14).has_value());
    // Command 28 admits anyone but never reads the lookup entitlement.
    EXPECT_FALSE(decide(28, identity)->lookup().has_value());
}

// Specific entitlements open their own commands only, entitled but not unrestricted; allowed
// alone reaches wipe as unrestricted, with no identifiers.
TEST_F(STWEntitlementDecisionTest, SpecificEntitlementsOpenOnlyTheirCommands) {
    auto identity = caller({{"com.vorlane.private.Stowly.otherIdLookup", STWValue(1)},
                            {"com.vorlane.private.Stowly.userManagedAssets", STWValue(true)},
                            {"com.vorlane.private.Stowly.wipeContainer",
                             STWValue(STWValue::Array{STWValue("com.example.plugin")})}});
    auto assets = decide(29, identity), wipe = decide(11, identity);
    ASSERT_TRUE(assets && wipe);
    EXPECT_TRUE(assets->entitled() && assets->allowOtherIdLookup() && wipe->entitled());
    EXPECT_FALSE(assets->unrestricted() || wipe->unrestricted());
    EXPECT_EQ(wipe->entitledWipeIdentifiers().value_or(STWValue::Array()).size(), 1u);
    EXPECT_NE(decide(4, identity), nullptr);
    EXPECT_EQ(decide(2, identity), nullptr);
    EXPECT_EQ(decide(10, identity), nullptr);

    auto allowed = decide(11, caller({{"com.vorlane.private.Stowly.allowed", STWValue(true)}}));
    ASSERT_NE(allowed, nullptr);
    EXPECT_TRUE(allowed->entitled() && !allowed->entitledWipeIdentifiers());
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

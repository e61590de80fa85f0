// The group, system-container and code-signing commands over the socket, and sandbox tokens.
#include "tests/e2e/STWE2ETestSupport.h"

#include <gtest/gtest.h>

using namespace STWE2E;

namespace {

const STWValue::Dictionary& dictionary(const STWValue::Dictionary& reply, const char* key) {
    static const STWValue::Dictionary none;
    const STWValue::Dictionary* d = STWDictionaryDictionary(reply, key);
    return d ? *d : none;
}

// The installer tells the daemon `identifier`'s entitlements, or nothing (the app is gone).
void install(STWClient& installer, const std::string& identifier, std::optional<STWValue::Dictionary> entitlements) {
    auto k = entitlements ? codeSigningKeys(identifier, *entitlements)
                          : STWValue::Dictionary{{"Identifier", STWValue(identifier)}};
    ASSERT_EQ(STWDaemonProcess::replyError(installer, 18, k), STWErrorSuccess);
}
STWValue::Dictionary appGroups(STWValue value) { return {{"com.vorlane.security.application-groups", std::move(value)}}; }
STWValue::Dictionary appGroups(std::initializer_list<const char*> names) {
    return appGroups(STWValue(STWValue::Array(names.begin(), names.end())));
}

using STWGroupCommandsTest = SharedDaemonTest;

} // namespace

// Group lookups follow the owner and the lookup entitlement; a group container stays while
// any installed app names it.
TEST_F(STWGroupCommandsTest, GroupContainersFollowTheirOwners) {
    install(*client, "com.example.owner", appGroups({"group.owner"}));
    STWValue::Dictionary ofOwner{{"Identifier", STWValue("com.example.owner")}};
    auto lookupOf = [](STWValue appGroup) {
        return STWValue::Dictionary{
            {"com.vorlane.private.Stowly.lookup", STWValue(STWValue::Dictionary{{"appGroup", std::move(appGroup)}})}};
    };
    // A lone string allows nothing; in an array only the strings count.
    auto single = daemon->connectAs("com.example.single", lookupOf(STWValue("com.example.owner")));
    EXPECT_EQ(STWDaemonProcess::replyError(*single, 13, ofOwner), STWErrorNotEntitled);
    auto mixed = daemon->connectAs("com.example.mixed",
                                   lookupOf(STWValue(STWValue::Array{STWValue("com.example.owner"), STWValue(5)})));
    auto reply = STWDaemonProcess::send(*mixed, 13, ofOwner);
    ASSERT_EQ(code(reply), STWErrorSuccess);
    EXPECT_TRUE(dictionary(reply, "ReplyGroupContainerDict").count("group.owner"));
    EXPECT_EQ(STWDaemonProcess::replyError(*mixed, 13, {{"Identifier", STWValue("com.example.other")}}),
              STWErrorNotEntitled);
    // The owner itself needs no entitlement; a caller nobody knows gets nothing.
    auto owner = daemon->connectAs("com.example.owner", {});
    auto own = STWDaemonProcess::send(*owner, 13);
    ASSERT_EQ(code(own), STWErrorSuccess);
    EXPECT_EQ(dictionary(own, "ReplyGroupContainerDict"), dictionary(reply, "ReplyGroupContainerDict"));
    auto anonymous = daemon->connect();
    EXPECT_EQ(STWDaemonProcess::replyError(*anonymous, 13, ofOwner), STWErrorNotEntitled);
    EXPECT_EQ(STWDaemonProcess::replyError(*anonymous, 14, ofOwner), STWErrorNotEntitled);

    fs::path group = *dictionary(own, "ReplyGroupContainerDict").at("group.owner").string();
    ASSERT_TRUE(fs::is_directory(group));
    install(*client, "com.example.second", appGroups(STWValue("group.owner")));
    install(*client, "com.example.owner", std::nullopt);
    EXPECT_TRUE(fs::is_directory(group));
    install(*client, "com.example.second", std::nullopt);
    EXPECT_FALSE(fs::exists(group));
}

// A sandboxed caller of an enterprise persona gets a token it can use for its data container
// and one for each of its groups; a personal caller, sandboxed too, gets none.
TEST_F(STWGroupCommandsTest, SandboxedEnterpriseCallersGetVerifiableTokens) {
    install(*client, "com.example.work", appGroups({"group.work.a", "group.work.b"}));
    install(*client, "com.example.home", appGroups({"group.home"}));
    STWValue::Dictionary own{{"ContainerClass", STWValue(2)}, {"CreateIfNecessary", STWValue(true)}};
    auto work = daemon->connectAs("com.example.work", {}, true, "ENTERPRISE-1");
    auto data = STWDaemonProcess::send(*work, 0, own);
    ASSERT_EQ(code(data), STWErrorSuccess);
    EXPECT_EQ(data["ReplyPersonaUniqueString"], STWValue("ENTERPRISE-1"));
    const std::string* token = STWDictionaryString(data, "SandboxToken");
    EXPECT_TRUE(tokenVerifies(*daemon, token, STWSandboxExtension::containerClass, path(data)));
    EXPECT_FALSE(tokenVerifies(*daemon, token, STWSandboxExtension::containerClass, path(data).string() + "x"));
    auto reply = STWDaemonProcess::send(*work, 13);
    ASSERT_EQ(code(reply), STWErrorSuccess);
    const auto& paths = dictionary(reply, "ReplyGroupContainerDict");
    const auto& tokens = dictionary(reply, "SandboxTokenDict");
    ASSERT_EQ(paths.size(), 2u);
    ASSERT_EQ(tokens.size(), 2u);
    for (const auto& [group, where] : paths)
        EXPECT_TRUE(tokenVerifies(*daemon, tokens.at(group).string(), STWSandboxExtension::applicationGroupClass,
                                  *where.string()))
            << group;

    auto home = daemon->connectAs("com.example.home", {}, true);
    auto plain = STWDaemonProcess::send(*home, 0, own), plainGroups = STWDaemonProcess::send(*home, 13);
    ASSERT_EQ(code(plain), STWErrorSuccess);
    ASSERT_EQ(code(plainGroups), STWErrorSuccess);
    EXPECT_FALSE(plain.count("SandboxToken"));
    EXPECT_EQ(dictionary(plainGroups, "ReplyGroupContainerDict").size(), 1u);
    EXPECT_FALSE(plainGroups.count("SandboxTokenDict"));
}

TEST_F(STWGroupCommandsTest, SystemContainersAndSystemGroupsGoToWhomTheyBelong) {
    auto plain = daemon->connectAs("com.example.plain", {});
    // A system group nobody is entitled to is refused, also one that services probe for.
    EXPECT_EQ(STWDaemonProcess::replyError(*plain, 17, {{"GroupIdentifier", STWValue("systemgroup.com.example.x")}}),
              STWErrorNotEntitled);
    EXPECT_EQ(
        STWDaemonProcess::replyError(*plain, 17, {{"GroupIdentifier", STWValue("systemgroup.com.vorlane.hornbeam")}}),
        STWErrorNotEntitled);
    // Any caller finds a well-known system group.
    auto wellKnown = STWDaemonProcess::send(*plain, 17, {{"GroupIdentifier", STWValue("systemgroup.com.vorlane.alder")}});
    ASSERT_EQ(code(wellKnown), STWErrorSuccess);
    EXPECT_TRUE(fs::is_directory(path(wellKnown)));

    // Any caller finds a well-known system container; an app its own only when entitled, never another's.
    auto maple = STWDaemonProcess::send(*plain, 15, {{"Identifier", STWValue("com.vorlane.maple")}});
    ASSERT_EQ(code(maple), STWErrorSuccess);
    EXPECT_EQ(path(maple).filename(), "com.vorlane.maple");
    EXPECT_EQ(STWDaemonProcess::replyError(*plain, 15), STWErrorNotEntitled);
    install(*client, "com.example.service", {{{"com.vorlane.security.system-container", STWValue(true)}}});
    auto service = daemon->connectAs("com.example.service", {});
    auto own = STWDaemonProcess::send(*service, 15);
    ASSERT_EQ(code(own), STWErrorSuccess);
    EXPECT_TRUE(fs::is_directory(path(own)));
    EXPECT_EQ(STWDaemonProcess::replyError(*plain, 15, {{"Identifier", STWValue("com.example.service")}}),
              STWErrorNotEntitled);
}

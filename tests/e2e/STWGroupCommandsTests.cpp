#include "tests/support/STWDaemonProcess.h"
#include "tests/support/STWTestRoot.h"

#include "common/STWError.h"
#include "common/STWFileIO.h"
#include "platform/STWAuditToken.h"
#include "platform/STWSandboxExtension.h"

#include <gtest/gtest.h>

#include <unistd.h>

namespace {

const STWValue::Dictionary allowed{{"com.vorlane.private.Stowly.allowed", STWValue(true)}};

uint64_t code(const STWValue::Dictionary& reply) { return STWDictionaryUInt64(reply, "ReplyError").value_or(0); }

const STWValue::Dictionary& dictionary(const STWValue::Dictionary& reply, const char* key) {
    static const STWValue::Dictionary none;
    const STWValue::Dictionary* d = STWDictionaryDictionary(reply, key);
    return d ? *d : none;
}

STWValue groups(std::initializer_list<const char*> names) {
    STWValue::Array array;
    for (const char* name : names)
        array.emplace_back(name);
    return STWValue(std::move(array));
}

class STWGroupCommandsTest : public ::testing::Test {
protected:
    static void SetUpTestSuite() {
        daemon = new STWDaemonProcess({{"DeveloperMode", STWValue(true)}},
                                      {STWTestRoot::persona("PERSONAL-1", 1000, "personal"),
                                       STWTestRoot::persona("ENTERPRISE-1", 1001, "enterprise",
                                                            {STWValue("com.example.work")})},
                                      false);
        daemon->setStandardErrorFile(daemon->root() / "stowlyd.stderr");
        ASSERT_TRUE(daemon->start());
    }
    static void TearDownTestSuite() {
        delete daemon;
        daemon = nullptr;
    }

    // What the installer tells the daemon about `identifier`: its entitlements, or nothing
    // (the app is gone).
    static void install(const std::string& identifier, std::optional<STWValue::Dictionary> entitlements) {
        auto installer = daemon->connectAs("com.example.installer", allowed);
        ASSERT_NE(installer, nullptr);
        STWValue::Dictionary keys{{"Identifier", STWValue(identifier)}};
        if (entitlements)
            keys["CodeSigningInfo"] =
                STWValue(STWValue::Dictionary{{"com.vorlane.Stowly.Entitlements", STWValue(*entitlements)}});
        ASSERT_EQ(STWDaemonProcess::replyError(*installer, 18, keys), STWErrorSuccess);
    }
    static STWValue::Dictionary appGroups(STWValue value) {
        return {{"com.vorlane.security.application-groups", std::move(value)}};
    }
    static std::string log() {
        std::string text;
        STWReadFileContents(daemon->root() / "stowlyd.stderr", &text);
        return text;
    }

    static STWDaemonProcess* daemon;
};
STWDaemonProcess* STWGroupCommandsTest::daemon = nullptr;

} // namespace

TEST_F(STWGroupCommandsTest, GroupLookupsFollowTheOwnerAndTheLookupEntitlement) {
    install("com.example.owner", appGroups(groups({"group.owner"})));
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
}

TEST_F(STWGroupCommandsTest, SandboxedEnterpriseCallerGetsATokenPerGroup) {
    install("com.example.work", appGroups(groups({"group.work.a", "group.work.b"})));
    auto work = daemon->connectAs("com.example.work", {}, true, "ENTERPRISE-1");
    auto reply = STWDaemonProcess::send(*work, 13);
    ASSERT_EQ(code(reply), STWErrorSuccess);
    const auto& paths = dictionary(reply, "ReplyGroupContainerDict");
    const auto& tokens = dictionary(reply, "SandboxTokenDict");
    ASSERT_EQ(paths.size(), 2u);
    ASSERT_EQ(tokens.size(), 2u);
    std::string key;
    ASSERT_EQ(STWReadFileContents(daemon->root() / "run/stowly/extension.key", &key), 0);
    auto auditToken = STWAuditToken::forProcess(getpid(), geteuid(), getegid());
    ASSERT_TRUE(auditToken.has_value());
    for (const auto& [group, path] : paths)
        EXPECT_TRUE(STWSandboxExtension::verify(*tokens.at(group).string(), STWSandboxExtension::applicationGroupClass,
                                                *path.string(), *auditToken, key))
            << group;

    // A personal caller's groups come without tokens.
    install("com.example.home", appGroups(groups({"group.home"})));
    auto home = daemon->connectAs("com.example.home", {}, true);
    auto plain = STWDaemonProcess::send(*home, 13);
    ASSERT_EQ(code(plain), STWErrorSuccess);
    EXPECT_EQ(dictionary(plain, "ReplyGroupContainerDict").size(), 1u);
    EXPECT_FALSE(plain.count("SandboxTokenDict"));
}

TEST_F(STWGroupCommandsTest, SystemContainersAndSystemGroupsGoToWhomTheyBelong) {
    auto plain = daemon->connectAs("com.example.plain", {});
    // A system group nobody is entitled to is refused; one services probe for is refused
    // without a word in the log.
    EXPECT_EQ(STWDaemonProcess::replyError(*plain, 17, {{"GroupIdentifier", STWValue("systemgroup.com.example.x")}}),
              STWErrorNotEntitled);
    EXPECT_EQ(
        STWDaemonProcess::replyError(*plain, 17, {{"GroupIdentifier", STWValue("systemgroup.com.vorlane.hornbeam")}}),
        STWErrorNotEntitled);
    // Any caller finds a well-known system group.
    auto wellKnown = STWDaemonProcess::send(*plain, 17, {{"GroupIdentifier", STWValue("systemgroup.com.vorlane.alder")}});
    ASSERT_EQ(code(wellKnown), STWErrorSuccess);
    EXPECT_TRUE(std::filesystem::is_directory(*STWDictionaryString(wellKnown, "ReplyPath")));

    // Any caller finds a well-known system container; an app has its own only when its
    // entitlements ask for one, and never another's.
    auto maple = STWDaemonProcess::send(*plain, 15, {{"Identifier", STWValue("com.vorlane.maple")}});
    ASSERT_EQ(code(maple), STWErrorSuccess);
    EXPECT_EQ(std::filesystem::path(*STWDictionaryString(maple, "ReplyPath")).filename(), "com.vorlane.maple");
    EXPECT_EQ(STWDaemonProcess::replyError(*plain, 15), STWErrorNotEntitled);
    install("com.example.service", {{{"com.vorlane.security.system-container", STWValue(true)}}});
    auto service = daemon->connectAs("com.example.service", {});
    auto own = STWDaemonProcess::send(*service, 15);
    ASSERT_EQ(code(own), STWErrorSuccess);
    EXPECT_TRUE(std::filesystem::is_directory(*STWDictionaryString(own, "ReplyPath")));
    EXPECT_EQ(STWDaemonProcess::replyError(*plain, 15, {{"Identifier", STWValue("com.example.service")}}),
              STWErrorNotEntitled);

    std::string text = log();
    EXPECT_NE(text.find("is not entitled for system group identifier: systemgroup.com.example.x"), std::string::npos);
    EXPECT_EQ(text.find("systemgroup.com.vorlane.hornbeam"), std::string::npos);
}

TEST_F(STWGroupCommandsTest, AGroupContainerStaysWhileAnyInstalledAppNamesIt) {
    install("com.example.first", appGroups(groups({"group.shared"})));
    install("com.example.second", appGroups(STWValue("group.shared")));
    auto first = daemon->connectAs("com.example.first", {});
    auto reply = STWDaemonProcess::send(*first, 13);
    ASSERT_EQ(code(reply), STWErrorSuccess);
    std::filesystem::path group = *dictionary(reply, "ReplyGroupContainerDict").at("group.shared").string();
    ASSERT_TRUE(std::filesystem::is_directory(group));
    install("com.example.first", std::nullopt);
    EXPECT_TRUE(std::filesystem::is_directory(group));
    install("com.example.second", std::nullopt);
    EXPECT_FALSE(std::filesystem::exists(group));
}

#include "Daemon/CodeSigning/STWWhitelist.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <algorithm>

namespace {

std::vector<std::string> sorted(std::vector<std::string> v) {
    std::sort(v.begin(), v.end());
    return v;
}

TEST(STWWhitelist, WellknownContainersAnswerOnlyForTheirOwnClass) {
    STWWhitelistRef whitelist = STWWhitelist::configuredWhitelistForInternalImage(false);
    EXPECT_TRUE(whitelist->systemContainerIdIsWellknown("com.vorlane.maple"));
    EXPECT_TRUE(whitelist->containerIdIsWellknown("com.vorlane.maple", 12));
    EXPECT_FALSE(whitelist->containerIdIsWellknown("com.vorlane.maple", 13));
    EXPECT_FALSE(whitelist->systemGroupContainerIdIsWellknown("com.vorlane.maple"));
    EXPECT_TRUE(whitelist->containerIdIsWellknown("systemgroup.com.vorlane.juniper", 13));
    EXPECT_FALSE(whitelist->containerIdIsWellknown("systemgroup.com.vorlane.juniper", 12));
    for (STWContainerClass c : {0ull, 1ull, 2ull, 7ull, 10ull, 14ull})
        EXPECT_FALSE(whitelist->containerIdIsWellknown("com.vorlane.oak", c)) << c;

    EXPECT_EQ(whitelist->wellknownContainerForId("com.vorlane.oak", 12), "com.vorlane.oak");
    EXPECT_EQ(whitelist->wellknownSystemGroupContainerForId("systemgroup.com.vorlane.alder"),
              "systemgroup.com.vorlane.alder");
    EXPECT_EQ(whitelist->wellknownContainerForId("com.vorlane.oak", 13), std::nullopt);
    EXPECT_EQ(whitelist->wellknownContainerForId("com.vorlane.oak", 2), std::nullopt);
    EXPECT_EQ(whitelist->wellknownSystemContainerForId("com.vorlane.unknown"), std::nullopt);
    // Identifiers are matched exactly, never by prefix or case.
    EXPECT_FALSE(whitelist->systemContainerIdIsWellknown("com.vorlane.Maple"));
    EXPECT_FALSE(whitelist->systemGroupContainerIdIsWellknown("systemgroup.com.vorlane"));

    EXPECT_EQ(sorted(whitelist->wellknownSystemContainers()),
              (std::vector<std::string>{"com.vorlane.maple", "com.vorlane.oak"}));
    EXPECT_EQ(whitelist->wellknownSystemGroupContainers().size(), 8u);
}

TEST(STWWhitelist, InternalBuildAddsItsSystemGroup) {
    STWWhitelistRef external = STWWhitelist::configuredWhitelistForInternalImage(false);
    STWWhitelistRef internal = STWWhitelist::configuredWhitelistForInternalImage(true);
    EXPECT_FALSE(external->systemGroupContainerIdIsWellknown("systemgroup.com.vorlane.larch"));
    EXPECT_TRUE(internal->systemGroupContainerIdIsWellknown("systemgroup.com.vorlane.larch"));
    EXPECT_EQ(internal->wellknownContainerForId("systemgroup.com.vorlane.larch", 13),
              "systemgroup.com.vorlane.larch");
    std::vector<std::string> expected = external->wellknownSystemGroupContainers();
    expected.push_back("systemgroup.com.vorlane.larch");
    EXPECT_EQ(sorted(internal->wellknownSystemGroupContainers()), sorted(expected));
    EXPECT_EQ(internal->wellknownSystemContainers(), external->wellknownSystemContainers());
}

// The shared instance is built once per process from the configuration in force, so each
// of these relies on running in a process of its own (CTest runs every case apart).
TEST(STWWhitelist, SharedWhitelistOfAnInternalImage) {
    STWTestRoot::shared().writeSettings({{"InternalImage", true}});
    EXPECT_TRUE(
        STWWhitelist::sharedWhitelist()->systemGroupContainerIdIsWellknown("systemgroup.com.vorlane.larch"));
    EXPECT_EQ(STWWhitelist::sharedWhitelist(), STWWhitelist::sharedWhitelist());
}

TEST(STWWhitelist, SharedWhitelistOfAnExternalImage) {
    STWTestRoot::shared().writeSettings({{"InternalImage", false}});
    EXPECT_FALSE(
        STWWhitelist::sharedWhitelist()->systemGroupContainerIdIsWellknown("systemgroup.com.vorlane.larch"));
    EXPECT_TRUE(
        STWWhitelist::sharedWhitelist()->systemGroupContainerIdIsWellknown("systemgroup.com.vorlane.hazel"));
}

TEST(STWWhitelist, LookupExceptionsGrantOnlyWhatTheirRuleNames) {
    STWWhitelistRef whitelist = STWWhitelist::configuredWhitelistForInternalImage(false);
    auto allowed = [&](const char* client, STWContainerClass c, const char* container) {
        return whitelist->isLookupWhitelistedFromCodeSignIdentifier(client, c, container);
    };
    EXPECT_TRUE(allowed("com.vorlane.walnut", 2, "com.vorlane.willow"));
    EXPECT_FALSE(allowed("com.vorlane.walnut", 2, "com.vorlane.poplar"));
    EXPECT_FALSE(allowed("com.vorlane.walnut", 7, "com.vorlane.willow"));
    EXPECT_FALSE(allowed("com.vorlane.walnut", 7, "com.vorlane.sumac"));
    EXPECT_TRUE(allowed("com.vorlane.linden", 2, "com.vorlane.poplar"));
    EXPECT_TRUE(allowed("com.vorlane.rowan", 7, "com.vorlane.sumac"));
    EXPECT_FALSE(allowed("com.vorlane.rowan", 2, "com.vorlane.sumac"));

    // Unrestricted clients reach every class there is, and nothing beyond.
    for (const char* client : {"com.vorlane.quince", "com.vorlane.tamarack", "com.vorlane.upas",
                               "com.vorlane.yew", "com.vorlane.aspen", "com.vorlane.spruce"}) {
        EXPECT_TRUE(allowed(client, 1, "anything")) << client;
        EXPECT_TRUE(allowed(client, 13, "systemgroup.anything")) << client;
        EXPECT_FALSE(allowed(client, 14, "anything")) << client;
        EXPECT_FALSE(allowed(client, UINT64_MAX, "anything")) << client;
    }

    // The class 10 container open to every client, signed or not.
    for (const char* client : {"", "com.example.stranger", "com.vorlane.walnut"}) {
        EXPECT_TRUE(allowed(client, 10, "com.vorlane.pine")) << client;
        EXPECT_FALSE(allowed(client, 2, "com.vorlane.pine")) << client;
        EXPECT_FALSE(allowed(client, 14, "com.vorlane.pine")) << client;
    }
    EXPECT_FALSE(allowed("com.example.stranger", 10, "com.vorlane.oak"));
    EXPECT_FALSE(allowed("com.vorlane.Quince", 2, "anything"));
}

TEST(STWWhitelist, TablesGivenToTheInitialiserKeepTheirAnyMarkersAndDirectoryNames) {
    STWWhitelistRef whitelist = STWWhitelist::initWithSystemContainerMapping(
        {{"com.example.system", "SystemDirectory"}}, {{"systemgroup.com.example.group", "GroupDirectory"}},
        {{4, {"com.example.open"}}, {14, {"com.example.beyond"}}, {99, {"com.example.beyond"}}},
        {{"com.example.plugins",
          STWWhitelist::ClassRules{{4, std::nullopt}, {6, std::vector<std::string>{}}}},
         {"com.example.everything", std::nullopt}});

    EXPECT_EQ(whitelist->wellknownContainerForId("com.example.system", 12), "SystemDirectory");
    EXPECT_EQ(whitelist->wellknownContainerForId("systemgroup.com.example.group", 13), "GroupDirectory");
    EXPECT_FALSE(whitelist->systemContainerIdIsWellknown("SystemDirectory"));

    EXPECT_TRUE(whitelist->isLookupWhitelistedFromCodeSignIdentifier("com.example.plugins", 4, "any.plugin"));
    EXPECT_FALSE(
        whitelist->isLookupWhitelistedFromCodeSignIdentifier("com.example.plugins", 6, "any.plugin"));
    EXPECT_FALSE(
        whitelist->isLookupWhitelistedFromCodeSignIdentifier("com.example.plugins", 2, "any.plugin"));
    EXPECT_TRUE(whitelist->isLookupWhitelistedFromCodeSignIdentifier("com.example.everything", 0, "x"));
    EXPECT_TRUE(whitelist->isLookupWhitelistedFromCodeSignIdentifier("nobody", 4, "com.example.open"));
    // Entries for class numbers beyond the last class are never consulted.
    EXPECT_FALSE(whitelist->isLookupWhitelistedFromCodeSignIdentifier("nobody", 14, "com.example.beyond"));
    EXPECT_FALSE(whitelist->isLookupWhitelistedFromCodeSignIdentifier("com.example.everything", 99,
                                                                      "com.example.beyond"));
}

} // namespace

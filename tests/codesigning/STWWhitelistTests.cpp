#include "Daemon/CodeSigning/STWWhitelist.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <set>

namespace {

// The matching rules, on tables of the test's own.
TEST(STWWhitelist, LookupRulesGrantOnlyWhatTheyName) {
    STWWhitelistRef whitelist = STWWhitelist::initWithSystemContainerMapping(
        {{"com.example.system", "SystemDirectory"}}, {{"systemgroup.com.example.group", "GroupDirectory"}},
        {{4, {"com.example.open"}}, {14, {"com.example.beyond"}}, {99, {"com.example.beyond"}}},
        {{"com.example.plugins", STWWhitelist::ClassRules{{4, std::nullopt}, {6, std::vector<std::string>{}}}},
         {"com.example.named", STWWhitelist::ClassRules{{2, std::vector<std::string>{"com.example.target"}}}},
         {"com.example.everything", std::nullopt}});
    struct Case {
        const char* client;
        STWContainerClass containerClass;
        const char* container;
        bool allowed;
    } cases[] = {
        {"com.example.plugins", 4, "any.plugin", true},     // any container of the class
        {"com.example.plugins", 6, "any.plugin", false},    // an empty list names nothing
        {"com.example.plugins", 2, "any.plugin", false},    // a class without a rule
        {"com.example.named", 2, "com.example.target", true},
        {"com.example.named", 2, "com.example.other", false},
        {"com.example.named", 7, "com.example.target", false},
        {"com.example.Named", 2, "com.example.target", false}, // exact match, never by case
        {"com.example.everything", 0, "x", true},
        {"com.example.everything", 13, "x", true},
        {"com.example.everything", 14, "x", false}, // beyond the last class nothing is consulted
        {"com.example.everything", UINT64_MAX, "x", false},
        {"", 4, "com.example.open", true}, // open to every client, signed or not
        {"nobody", 2, "com.example.open", false},
        {"nobody", 14, "com.example.beyond", false},
        {"com.example.everything", 99, "com.example.beyond", false},
    };
    for (const Case& c : cases)
        EXPECT_EQ(whitelist->isLookupWhitelistedFromCodeSignIdentifier(c.client, c.containerClass, c.container), c.allowed)
            << c.client << " " << c.containerClass << " " << c.container;

    // Well-known containers answer for their own class only, with their directory name.
    EXPECT_EQ(whitelist->wellknownContainerForId("com.example.system", 12), "SystemDirectory");
    EXPECT_EQ(whitelist->wellknownContainerForId("systemgroup.com.example.group", 13), "GroupDirectory");
    EXPECT_FALSE(whitelist->containerIdIsWellknown("com.example.system", 13));
    EXPECT_FALSE(whitelist->containerIdIsWellknown("systemgroup.com.example.group", 12));
    EXPECT_FALSE(whitelist->wellknownContainerForId("com.example.system", 2));
    EXPECT_FALSE(whitelist->systemContainerIdIsWellknown("SystemDirectory"));
    EXPECT_FALSE(whitelist->systemGroupContainerIdIsWellknown("systemgroup.com.example"));
}

// The shared instance is built once per process from the configuration in force, so each
// of these relies on running in a process of its own (CTest runs every case apart).
TEST(STWWhitelist, SharedWhitelistOfAnInternalImageAddsItsSystemGroupAndNothingElse) {
    STWTestRoot::shared().writeSettings({{"InternalImage", true}});
    STWWhitelistRef external = STWWhitelist::configuredWhitelistForInternalImage(false);
    STWWhitelistRef internal = STWWhitelist::sharedWhitelist();
    EXPECT_FALSE(external->systemGroupContainerIdIsWellknown("systemgroup.com.vorlane.larch"));
    EXPECT_TRUE(internal->containerIdIsWellknown("systemgroup.com.vorlane.larch", 13));
    std::vector<std::string> expected = external->wellknownSystemGroupContainers();
    expected.push_back("systemgroup.com.vorlane.larch");
    std::vector<std::string> got = internal->wellknownSystemGroupContainers();
    EXPECT_EQ(std::set<std::string>(got.begin(), got.end()), std::set<std::string>(expected.begin(), expected.end()));
    EXPECT_EQ(internal->wellknownSystemContainers(), external->wellknownSystemContainers());
}

TEST(STWWhitelist, SharedWhitelistOfAnExternalImage) {
    STWTestRoot::shared().writeSettings({{"InternalImage", false}});
    EXPECT_FALSE(STWWhitelist::sharedWhitelist()->systemGroupContainerIdIsWellknown("systemgroup.com.vorlane.larch"));
}

} // namespace

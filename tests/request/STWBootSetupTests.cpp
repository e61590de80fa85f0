#include "Daemon/Lifecycle/STWContainerCache.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "Daemon/Request/STWClientConnection.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

namespace fs = std::filesystem;

// A build upgrade moves every system and system group container to a new UUID directory,
// except the well-known ones and the telemetry group, which keep their paths; the cache
// follows the moves.
TEST(STWBootSetup, ABuildUpgradeGivesOnlyOrdinarySystemContainersNewDirectories) {
    STWTestRoot::shared();
    auto connection = STWClientConnection::sharedClientConnection();
    struct Case {
        const char* identifier;
        STWContainerClass containerClass;
        bool moves;
        fs::path before;
    };
    Case cases[] = {{"com.example.system", STWContainerClassDataSystem, true, {}},
                    {"com.vorlane.maple", STWContainerClassDataSystem, false, {}},
                    {"systemgroup.com.example.group", STWContainerClassSharedSystemGroup, true, {}},
                    {"systemgroup.com.vorlane.telemetry", STWContainerClassSharedSystemGroup, false, {}},
                    {"systemgroup.com.vorlane.alder", STWContainerClassSharedSystemGroup, false, {}}};
    auto identity = [](const Case& c) {
        return STWContainerIdentity::containerIdentityWithIdentifier(c.identifier, c.containerClass, nullptr);
    };
    for (Case& c : cases) {
        uint64_t code = STWErrorSuccess;
        auto made = connection->createOrLookupContainerWithContainerIdentity(identity(c), true, false, true, &code);
        ASSERT_TRUE(made) << c.identifier << ": " << code;
        c.before = made->url();
    }
    connection->_regenerateAllSystemContainerPaths();
    for (const Case& c : cases) {
        SCOPED_TRACE(c.identifier);
        uint64_t code = STWErrorSuccess;
        auto found = connection->createOrLookupContainerWithContainerIdentity(identity(c), false, false, true, &code);
        ASSERT_TRUE(found);
        EXPECT_EQ(found->url() != c.before, c.moves);
        EXPECT_TRUE(fs::is_directory(found->url()));
        EXPECT_EQ(fs::exists(c.before), !c.moves);
    }
}

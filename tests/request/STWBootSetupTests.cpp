#include "Daemon/Request/STWClientConnection.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

// A build upgrade moves system and system group containers to new UUID directories, except
// the well-known ones and the telemetry group; look-ups follow the moves.
TEST(STWBootSetup, ABuildUpgradeGivesOnlyOrdinarySystemContainersNewDirectories) {
    STWTestRoot::shared();
    auto connection = STWClientConnection::sharedClientConnection();
    std::tuple<const char*, STWContainerClass, bool> cases[] = {
        {"com.example.system", 12, true},
        {"com.vorlane.maple", 12, false},
        {"systemgroup.com.example.group", 13, true},
        {"systemgroup.com.vorlane.telemetry", 13, false},
        {"systemgroup.com.vorlane.alder", 13, false}};
    auto container = [&](auto& c, bool create) {
        uint64_t code = STWErrorSuccess;
        auto identity =
            STWContainerIdentity::containerIdentityWithIdentifier(std::get<0>(c), std::get<1>(c), nullptr);
        auto found =
            connection->createOrLookupContainerWithContainerIdentity(identity, create, false, true, &code);
        return found ? found->url() : std::filesystem::path();
    };
    std::vector<std::filesystem::path> before;
    for (auto& c : cases)
        before.push_back(container(c, true));
    connection->_regenerateAllSystemContainerPaths();
    for (size_t i = 0; i < std::size(cases); ++i) {
        SCOPED_TRACE(std::get<0>(cases[i]));
        std::filesystem::path after = container(cases[i], false);
        EXPECT_TRUE(std::filesystem::is_directory(after));
        EXPECT_EQ(after != before[i], std::get<2>(cases[i]));
        EXPECT_EQ(std::filesystem::exists(before[i]), !std::get<2>(cases[i]));
    }
}

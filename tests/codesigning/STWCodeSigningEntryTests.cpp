#include "Daemon/CodeSigning/STWCodeSigningEntry.h"

#include <gtest/gtest.h>

#include <functional>
#include <vector>

namespace {

STWCodeSigningEntry sampleEntry() {
    STWValue::Dictionary info{
        {"com.vorlane.Stowly.Entitlements",
         STWValue(STWValue::Dictionary{{"com.vorlane.security.system-container", STWValue(true)}})}};
    STWCodeSigningEntry entry(std::move(info), 2);
    entry.setChildBundleIdentifiers(std::vector<std::string>{"com.example.widget", "com.example.share"});
    return entry;
}

// The mapping skips a write when the new entry equals the stored one, so every field must
// take part in equality, and equal entries must hash alike.
TEST(STWCodeSigningEntryTest, EveryFieldTakesPartInEquality) {
    STWCodeSigningEntry base = sampleEntry();
    STWCodeSigningEntry same = sampleEntry();
    EXPECT_EQ(base, same);
    EXPECT_EQ(base.hash(), same.hash());
    EXPECT_EQ(STWCodeSigningEntry(), STWCodeSigningEntry());

    std::vector<std::function<void(STWCodeSigningEntry&)>> changes{
        [](STWCodeSigningEntry& e) { e.setInvalid(true); },
        [](STWCodeSigningEntry& e) { e.setPlaceholder(true); },
        [](STWCodeSigningEntry& e) { e.setAdvanceCopy(true); },
        [](STWCodeSigningEntry& e) { e.setRegisteredByCaller(true); },
        [](STWCodeSigningEntry& e) { e.setDataContainerClass(0); },
        [](STWCodeSigningEntry& e) { e.setCodeSigningInfo(std::nullopt); },
        [](STWCodeSigningEntry& e) { e.setCodeSigningInfo(STWValue::Dictionary{}); },
        // No child list is not the same as an empty one.
        [](STWCodeSigningEntry& e) { e.setChildBundleIdentifiers(std::vector<std::string>{}); },
        [](STWCodeSigningEntry& e) { e.setChildBundleIdentifiers(std::nullopt); },
        [](STWCodeSigningEntry& e) {
            e.setChildBundleIdentifiers(std::vector<std::string>{"com.example.share", "com.example.widget"});
        },
    };
    for (size_t i = 0; i < changes.size(); ++i) {
        STWCodeSigningEntry changed = sampleEntry();
        changes[i](changed);
        EXPECT_NE(changed, base) << "change " << i << ": " << changed.description();
    }
}

} // namespace

#include "common/STWDictionaryUtilities.h"
#include "platform/STWClientRegistry.h"
#include "tests/support/STWEventLoopThread.h"

#include <gtest/gtest.h>

#include <chrono>
#include <fcntl.h>
#include <fstream>
#include <thread>
#include <unistd.h>

namespace {

class STWClientRegistryTest : public ::testing::Test {
protected:
    void SetUp() override {
        char templ[] = "/tmp/stowly-registry-XXXXXX";
        ASSERT_NE(mkdtemp(templ), nullptr);
        dir = templ;
        std::filesystem::create_directories(dir / "clients.d");
        executable = dir / "tool";
        std::ofstream(executable) << "#!/bin/true\n";
    }
    void TearDown() override { std::filesystem::remove_all(dir); }

    void writeEntry(const char* name, STWValue::Dictionary entry) {
        ASSERT_TRUE(STW_writeToURL(entry, dir / "clients.d" / name, STWWriteAtomic, nullptr));
    }
    STWClientRegistryEntryRef lookup(STWClientRegistry& registry, STWErrorRef* error = nullptr) {
        int fd = open(executable.c_str(), O_RDONLY | O_CLOEXEC);
        auto entry = registry.entryForExecutable(executable, fd, error);
        close(fd);
        return entry;
    }

    std::filesystem::path dir, executable;
};

STWValue::Dictionary entryFor(const std::filesystem::path& executable, std::optional<std::string> digest = {}) {
    STWValue::Dictionary d{{"CodeSigningIdentifier", STWValue("com.example.tool")},
                           {"Executable", STWValue(executable.native())},
                           {"Entitlements", STWValue(STWValue::Dictionary{{"a", STWValue(true)}})}};
    if (digest)
        d["SHA256"] = STWValue(*digest);
    return d;
}

} // namespace

// An entry pinned to another digest is refused in the end-to-end tests.
TEST_F(STWClientRegistryTest, DigestPinsTheExecutable) {
    std::string digest;
    {
        FILE* p = popen(("sha256sum " + executable.native()).c_str(), "r");
        char line[128] = {};
        ASSERT_NE(fgets(line, sizeof line, p), nullptr);
        pclose(p);
        digest.assign(line, 64);
    }
    STWClientRegistry registry(dir / "clients.d");
    writeEntry("tool.plist", entryFor(executable, digest));
    registry.reload();
    auto entry = lookup(registry);
    ASSERT_NE(entry, nullptr);
    EXPECT_EQ(entry->codeSigningIdentifier, "com.example.tool");

    // The same executable changed on disk no longer matches its pin.
    std::ofstream(executable, std::ios::app) << "# tampered\n";
    STWErrorRef error;
    EXPECT_EQ(lookup(registry, &error), nullptr);
    ASSERT_NE(error, nullptr);
    EXPECT_TRUE(error->isPOSIX(EPERM));
}

TEST_F(STWClientRegistryTest, BadFilesAreSkippedAndChangesAreNoticed) {
    std::ofstream(dir / "clients.d" / "garbage.plist") << "not a property list";
    writeEntry("relative.plist", {{"CodeSigningIdentifier", STWValue("x")}, {"Executable", STWValue("bin/x")}});
    writeEntry("nosigning.plist", {{"Executable", STWValue(executable.native())}});
    STWClientRegistry registry(dir / "clients.d");
    registry.reload();
    EXPECT_EQ(lookup(registry), nullptr);

    // An entry's arrival is noticed in the end-to-end tests; here its removal.
    writeEntry("tool.plist", entryFor(executable));
    registry.reload();
    ASSERT_NE(lookup(registry), nullptr);
    registry.watch();
    STWEventLoopThread loop;
    std::filesystem::remove(dir / "clients.d" / "tool.plist");
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
    while (lookup(registry) && std::chrono::steady_clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    EXPECT_EQ(lookup(registry), nullptr);
}

TEST(STWClientRegistryEntry, DeclaredIdentitiesNeedOnlyASigningIdentifier) {
    std::string reason;
    auto entry = STWClientRegistryEntry::fromDictionary(
        {{"CodeSigningIdentifier", STWValue("com.example")}, {"PersonaUniqueString", STWValue("P")},
         {"Sandboxed", STWValue(true)}},
        false, &reason);
    ASSERT_TRUE(entry.has_value()) << reason;
    EXPECT_TRUE(entry->sandboxed);
    EXPECT_EQ(entry->personaUniqueString.value_or(""), "P");
    EXPECT_FALSE(STWClientRegistryEntry::fromDictionary({{"CodeSigningIdentifier", STWValue("x")},
                                                         {"Sandboxed", STWValue("yes")}},
                                                        false, &reason));
    EXPECT_FALSE(STWClientRegistryEntry::fromDictionary({{"CodeSigningIdentifier", STWValue("")}}, false, &reason));
}

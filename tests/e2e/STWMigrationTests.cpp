// A device that an older release left behind, brought up to date by the first start of a
// new build and the two migration commands; the per-user passes; and a power cut at each
// step of the build upgrade.
#include "tests/e2e/STWE2ETestSupport.h"

#include "platform/STWCrashPoint.h"

#include <gtest/gtest.h>

#include <sys/stat.h>

using namespace STWE2E;

namespace {

const STWValue::Dictionary migrator{{"com.vorlane.private.Stowly.allowed", STWValue(true)},
                                    {"com.vorlane.private.Stowly.dataMigration", STWValue(true)}};
constexpr const char* kCachedInfoKey = "com.vorlane.Setwright.CachedCodeSigningInfo";
constexpr const char* kGroupIDsKey = "com.vorlane.Setwright.GroupContainerIDs";
constexpr const char* kProtectionKey = "com.vorlane.Setwright.ContentProtectionClass";

// Keys of an info-value command for the container that `made` (a reply of command 0) names.
STWValue::Dictionary info(const STWValue::Dictionary& made, uint64_t containerClass, const char* key) {
    return {{"Identifier", made.at("ReplyIdentifier")},
            {"ContainerClass", STWValue(containerClass)},
            {"UUID", made.at("ReplyUUID")},
            {"Key", STWValue(key)}};
}
void writePlist(const fs::path& file, const STWValue::Dictionary& dictionary) {
    EXPECT_TRUE(STW_writeToURL(dictionary, file, STWWriteAtomic, nullptr)) << file;
}

struct Device : Layout {
    fs::path statusFile() const { return library() / "stw_migration_status.plist"; }
    fs::path userStatusFile() const { return root / "private/var/mobile/Library/Stowly/stw_user_migration_status.plist"; }
    fs::path bundles() const { return root / "private/var/containers/Bundle"; }
    fs::path legacyBundles() const { return root / "private/var/mobile/Containers/Bundle"; }
    fs::path oldLogs() const { return root / "private/var/mobile/Library/Logs/Stowly"; }
    fs::path logs() const { return root / "private/var/root/Library/Logs/Stowly"; }

    void setBuild(const char* build) const { write(root / "etc/os-release", std::string("BUILD_ID=") + build + "\n"); }
    // The migration types the system store records.
    std::set<std::string> recordedTypes() const {
        std::set<std::string> types;
        if (auto status = STW_dictionaryWithContentsOfURL(statusFile(), 0, nullptr))
            for (const auto& [key, value] : *status)
                if (key != "LastBuildInfo")
                    types.insert(key);
        return types;
    }
    // Every path below the container directories.
    std::set<std::string> tree() const {
        std::set<std::string> paths;
        for (const fs::path& top : {root / "private/var/containers", root / "private/var/mobile/Containers"})
            for (const auto& entry : fs::recursive_directory_iterator(top))
                paths.insert(entry.path().lexically_relative(root));
        return paths;
    }
};

// A bundle container and the well-known system container com.vorlane.maple (each with a
// marker), then laid out as an older release kept them: the bundle directory in the mobile
// user's home, the well-known container under its UUID, no status file (no build recorded).
void makeOlderRelease(STWDaemonProcess& daemon, const Device& layout) {
    auto client = daemon.connectAs("com.example.installer", migrator);
    ASSERT_NE(client, nullptr);
    auto bundle = STWDaemonProcess::send(*client, 0, keys("com.example.app", 1));
    auto maple = STWDaemonProcess::send(*client, 0, keys("com.vorlane.maple", 12));
    ASSERT_EQ(code(bundle), STWErrorSuccess);
    ASSERT_EQ(code(maple), STWErrorSuccess);
    ASSERT_EQ(path(maple), layout.system() / "com.vorlane.maple");
    write(path(bundle) / "marker", "bundle");
    write(path(maple) / "marker", "maple");
    ASSERT_TRUE(daemon.stop());
    fs::rename(layout.bundles(), layout.legacyBundles());
    fs::rename(path(maple), layout.system() / maple["ReplyUUID"].uuid()->string());
    fs::remove(layout.statusFile());
}

// The containers of makeOlderRelease() are where the current layout puts them.
void expectCurrentLayout(STWDaemonProcess& daemon, const Device& layout) {
    auto client = daemon.connectAs("com.example.installer", migrator);
    ASSERT_NE(client, nullptr);
    fs::path bundle = path(STWDaemonProcess::send(*client, 0, keys("com.example.app", 1, false)));
    EXPECT_EQ(bundle.parent_path(), layout.bundles() / "Application");
    EXPECT_TRUE(fs::exists(bundle / "marker"));
    EXPECT_FALSE(fs::exists(layout.legacyBundles()));
    fs::path maple = path(STWDaemonProcess::send(*client, 15, {{"Identifier", STWValue("com.vorlane.maple")}}));
    EXPECT_EQ(maple, layout.system() / "com.vorlane.maple");
    EXPECT_TRUE(fs::exists(maple / "marker"));
}

} // namespace

// An older release's device (makeOlderRelease(), a well-known container already at its name,
// old status, mapping and log files, cached code-signing info and group identifiers): one power
// cycle and the two commands bring everything up to date; a second changes nothing.
TEST(STWMigration, AnOlderReleasesDeviceIsBroughtUpToDateOnce) {
    STWDaemonProcess daemon(developer, {}, false);
    Device layout{{daemon.root()}};
    layout.setBuild("A1");
    ASSERT_TRUE(daemon.start());
    STWValue::Dictionary bundle, data;
    fs::path oak;
    {
        auto client = daemon.connectAs("com.example.installer", migrator);
        ASSERT_NE(client, nullptr);
        bundle = STWDaemonProcess::send(*client, 0, keys("com.example.app", 1));
        data = STWDaemonProcess::send(*client, 0, keys("com.example.app", 2));
        ASSERT_EQ(code(bundle), STWErrorSuccess);
        ASSERT_EQ(code(data), STWErrorSuccess);
        auto setCached = info(bundle, 1, kCachedInfoKey), setGroups = info(data, 2, kGroupIDsKey);
        STWValue::Dictionary cached{{"com.example.cached", STWValue(true)}};
        setCached["Value"] = STWValue(STWValue::Dictionary{{"Entitlements", STWValue(cached)}});
        setGroups["Value"] = STWValue(STWValue::Array{STWValue("group.com.example")});
        ASSERT_EQ(code(STWDaemonProcess::send(*client, 5, setCached)), STWErrorSuccess);
        ASSERT_EQ(code(STWDaemonProcess::send(*client, 5, setGroups)), STWErrorSuccess);
        oak = path(STWDaemonProcess::send(*client, 15, {{"Identifier", STWValue("com.vorlane.oak")}}));
        ASSERT_EQ(oak, layout.system() / "com.vorlane.oak");
    }
    makeOlderRelease(daemon, layout);
    struct stat before {};
    ASSERT_EQ(stat(oak.c_str(), &before), 0);
    writePlist(layout.library() / "stw_acl2_migration_complete.plist",
               {{"STWMigrationVersionNumber", STWValue("A0")}, {"STWMigrationTime", STWValue("then")}});
    STWValue::Dictionary noEntitlements{{"com.vorlane.Stowly.Entitlements", STWValue(STWValue::Dictionary{})}};
    STWValue::Dictionary legacyEntry{{"CodeSigningInfo", STWValue(noEntitlements)},
                                     {"DataContainerClass", STWValue(uint64_t{2})}};
    writePlist(layout.library() / "stw_code_signing_info.plist", {{"com.example.legacy", STWValue(legacyEntry)}});
    write(layout.oldLogs() / "stowlyd.log.0", "zero");
    write(layout.oldLogs() / "stowlyd.log.3", "three");
    write(daemon.root() / "secret", "secret");
    fs::create_symlink(daemon.root() / "secret", layout.oldLogs() / "planted.0");
    layout.setBuild("B2");

    daemon.reboot();
    ASSERT_TRUE(daemon.start());
    ASSERT_TRUE(daemon.waitForCleanups(true));
    expectCurrentLayout(daemon, layout);
    // A well-known container already at its name is left alone (a rename would change it).
    struct stat after {};
    ASSERT_EQ(stat(oak.c_str(), &after), 0);
    EXPECT_EQ(after.st_ctim.tv_nsec, before.st_ctim.tv_nsec);
    EXPECT_EQ(after.st_ctim.tv_sec, before.st_ctim.tv_sec);
    // Only the logs this build's level keeps move; the link is not followed; the old directory goes.
    EXPECT_EQ(read(layout.logs() / "stowlyd.log.1"), "zero");
    EXPECT_FALSE(fs::exists(layout.logs() / "stowlyd.log.4"));
    EXPECT_FALSE(fs::exists(fs::symlink_status(layout.logs() / "planted.1")));
    EXPECT_FALSE(fs::exists(layout.oldLogs()));
    EXPECT_TRUE(fs::exists(daemon.root() / "secret"));
    EXPECT_FALSE(fs::exists(layout.library() / "stw_acl2_migration_complete.plist"));
    EXPECT_FALSE(fs::exists(layout.library() / "stw_code_signing_info.plist"));

    auto client = daemon.connectAs("com.example.installer", migrator);
    ASSERT_NE(client, nullptr);
    EXPECT_EQ(code(STWDaemonProcess::send(*client, 24)), STWErrorSuccess);
    EXPECT_EQ(code(STWDaemonProcess::send(*client, 30)), STWErrorSuccess);
    for (const char* identifier : {"com.example.app", "com.example.legacy"}) {
        auto stored = STWDaemonProcess::send(*client, 19, {{"Identifier", STWValue(identifier)}});
        EXPECT_EQ(code(stored), STWErrorSuccess) << identifier;
        const STWValue::Dictionary* csInfo = STWDictionaryDictionary(stored, "ReplyInfoDictionary");
        EXPECT_TRUE(csInfo && STWDictionaryDictionary(*csInfo, "com.vorlane.Stowly.Entitlements")) << identifier;
    }
    EXPECT_EQ(code(STWDaemonProcess::send(*client, 6, info(bundle, 1, kCachedInfoKey))), STWErrorInfoValueNotFound);
    EXPECT_EQ(code(STWDaemonProcess::send(*client, 6, info(data, 2, kGroupIDsKey))), STWErrorInfoValueNotFound);
    struct stat st {};
    fs::path bundlePath = path(STWDaemonProcess::send(*client, 0, keys("com.example.app", 1, false)));
    EXPECT_EQ(stat(bundlePath.c_str(), &st), 0);
    EXPECT_EQ(st.st_uid, 33u); // the installer's, as every bundle's
    std::set<std::string> all{"ACLMigration", "BundleMigration", "GroupIdMigration", "CodeSigningMigration"};
    EXPECT_EQ(layout.recordedTypes(), all);
    client.reset();

    auto tree = layout.tree();
    ASSERT_TRUE(daemon.stop());
    daemon.reboot();
    ASSERT_TRUE(daemon.start());
    ASSERT_TRUE(daemon.waitForCleanups(true));
    client = daemon.connectAs("com.example.installer", migrator);
    EXPECT_EQ(code(STWDaemonProcess::send(*client, 24)), STWErrorSuccess);
    EXPECT_EQ(code(STWDaemonProcess::send(*client, 30)), STWErrorSuccess);
    EXPECT_EQ(layout.tree(), tree);
    EXPECT_EQ(layout.recordedTypes(), all);
}

// Standard subdirectories are re-created once per mobile-user store; the protection class
// of a data container whose app has no bundle container is re-applied on every request.
TEST(STWMigration, ThePerUserPassesRunOncePerStoreAndOnEveryRequest) {
    STWDaemonProcess daemon(developer);
    Device layout{{daemon.root()}};
    auto client = daemon.connectAs("com.example.installer", migrator);
    ASSERT_NE(client, nullptr);
    STWValue::Dictionary entitlements{{"com.vorlane.developer.default-data-protection", STWValue("complete")}};
    ASSERT_EQ(STWDaemonProcess::replyError(*client, 18, codeSigningKeys("com.example.orphan", entitlements)),
              STWErrorSuccess);
    auto made = STWDaemonProcess::send(*client, 0, keys("com.example.orphan", 2));
    fs::path orphan = path(made);
    ASSERT_FALSE(orphan.empty());
    auto protectionClass = [&] {
        auto reply = STWDaemonProcess::send(*client, 6, info(made, 2, kProtectionKey));
        return reply.count("ReplyInfoValue") ? reply["ReplyInfoValue"].truncatedInt64Value().value_or(-1) : -1;
    };
    auto weaken = keys("com.example.orphan", 2, false);
    weaken["DataProtectionClass"] = STWValue(int64_t{3});

    ASSERT_EQ(code(STWDaemonProcess::send(*client, 30)), STWErrorSuccess);
    EXPECT_EQ(protectionClass(), 1);
    ASSERT_EQ(code(STWDaemonProcess::send(*client, 21, weaken)), STWErrorSuccess);
    ASSERT_EQ(protectionClass(), 3);
    fs::remove_all(orphan / "Documents");
    ASSERT_EQ(code(STWDaemonProcess::send(*client, 30)), STWErrorSuccess);
    EXPECT_EQ(protectionClass(), 1);
    EXPECT_FALSE(fs::exists(orphan / "Documents")); // the store records the pass

    ASSERT_TRUE(fs::remove(layout.userStatusFile()));
    ASSERT_EQ(code(STWDaemonProcess::send(*client, 30)), STWErrorSuccess);
    EXPECT_TRUE(fs::is_directory(orphan / "Documents"));
}

// A power cut at each rename of the build upgrade (points the crash torture never reaches):
// the next start, still an upgrade, finishes the migration and every container is found.
TEST(STWMigrationCrash, APowerCutDuringTheBuildUpgradeLosesNoContainer) {
    STWDaemonProcess daemon(internal);
    Device layout{{daemon.root()}};
    for (std::string_view point : STWCrashPoint::migration) {
        SCOPED_TRACE(std::string(point));
        makeOlderRelease(daemon, layout);
        daemon.reboot();
        // The points lie in the start-up: it may die before or after its socket answers.
        daemon.startWith("STOWLY_CRASH_AT", std::string(point));
        ASSERT_TRUE(daemon.killedItself());
        ASSERT_TRUE(daemon.start());
        ASSERT_TRUE(daemon.waitForCleanups(true));
        expectCurrentLayout(daemon, layout);
    }
}

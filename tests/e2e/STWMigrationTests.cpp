// A device that an older release left behind, brought up to date by the first start of a
// new build and the two migration commands; the per-user passes; and a power cut at each
// step of the build upgrade.
#include "tests/support/STWDaemonProcess.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWError.h"
#include "common/STWFileIO.h"
#include "platform/STWCrashPoint.h"

#include <gtest/gtest.h>

#include <fstream>
#include <set>
#include <sys/stat.h>

namespace fs = std::filesystem;

namespace {

const STWValue::Dictionary migrator{{"com.vorlane.private.Stowly.allowed", STWValue(true)},
                                    {"com.vorlane.private.Stowly.dataMigration", STWValue(true)}};
constexpr const char* kCachedInfoKey = "com.vorlane.Setwright.CachedCodeSigningInfo";
constexpr const char* kGroupIDsKey = "com.vorlane.Setwright.GroupContainerIDs";
constexpr const char* kProtectionKey = "com.vorlane.Setwright.ContentProtectionClass";

uint64_t code(const STWValue::Dictionary& reply) { return STWDictionaryUInt64(reply, "ReplyError").value_or(0); }
fs::path path(const STWValue::Dictionary& reply) {
    const std::string* p = STWDictionaryString(reply, "ReplyPath");
    return p ? fs::path(*p) : fs::path();
}
STWValue::Dictionary container(const std::string& identifier, uint64_t containerClass, bool create = true) {
    return {{"Identifier", STWValue(identifier)},
            {"ContainerClass", STWValue(containerClass)},
            {"CreateIfNecessary", STWValue(create)}};
}
// Keys of an info-value command for the container that `made` (a reply of command 0) names.
STWValue::Dictionary info(const STWValue::Dictionary& made, uint64_t containerClass, const char* key) {
    return {{"Identifier", made.at("ReplyIdentifier")},
            {"ContainerClass", STWValue(containerClass)},
            {"UUID", made.at("ReplyUUID")},
            {"Key", STWValue(key)}};
}
void write(const fs::path& file, const std::string& text) {
    fs::create_directories(file.parent_path());
    std::ofstream(file) << text;
}
void writePlist(const fs::path& file, const STWValue::Dictionary& dictionary) {
    STWErrorRef error;
    EXPECT_TRUE(STW_writeToURL(dictionary, file, STWWriteAtomic, &error)) << file;
}

struct Layout {
    fs::path root;
    fs::path library() const { return root / "private/var/root/Library/Stowly"; }
    fs::path statusFile() const { return library() / "stw_migration_status.plist"; }
    fs::path userStatusFile() const { return root / "private/var/mobile/Library/Stowly/stw_user_migration_status.plist"; }
    fs::path bundles() const { return root / "private/var/containers/Bundle"; }
    fs::path legacyBundles() const { return root / "private/var/mobile/Containers/Bundle"; }
    fs::path system() const { return root / "private/var/containers/Data/System"; }
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

// On a daemon of the current release: an app's bundle container (with `marker` inside) and
// the well-known system container com.vorlane.maple (likewise). Then, with the daemon
// stopped, the layout an older release kept: the bundle directory in the mobile user's
// home, the well-known container under its UUID, no status file (so no record of a build).
void makeOlderRelease(STWDaemonProcess& daemon, const Layout& layout) {
    auto client = daemon.connectAs("com.example.installer", migrator);
    ASSERT_NE(client, nullptr);
    auto bundle = STWDaemonProcess::send(*client, 0, container("com.example.app", 1));
    auto maple = STWDaemonProcess::send(*client, 0, container("com.vorlane.maple", 12));
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
void expectCurrentLayout(STWDaemonProcess& daemon, const Layout& layout) {
    auto client = daemon.connectAs("com.example.installer", migrator);
    ASSERT_NE(client, nullptr);
    fs::path bundle = path(STWDaemonProcess::send(*client, 0, container("com.example.app", 1, false)));
    EXPECT_EQ(bundle.parent_path(), layout.bundles() / "Application");
    EXPECT_TRUE(fs::exists(bundle / "marker"));
    EXPECT_FALSE(fs::exists(layout.legacyBundles()));
    fs::path maple = path(STWDaemonProcess::send(*client, 15, {{"Identifier", STWValue("com.vorlane.maple")}}));
    EXPECT_EQ(maple, layout.system() / "com.vorlane.maple");
    EXPECT_TRUE(fs::exists(maple / "marker"));
}

} // namespace

// An older release's device: the layout of makeOlderRelease() beside a well-known
// container already at its name, a marker file, a legacy
// mapping file, code-signing info cached in a bundle container, group identifiers in a data
// container, old log files (and a link an app planted among them), another build. One
// power cycle and the two commands bring everything where this build keeps it; a second
// power cycle and the commands again change nothing.
TEST(STWMigration, AnOlderReleasesDeviceIsBroughtUpToDateOnce) {
    STWDaemonProcess daemon({{"DeveloperMode", STWValue(true)}}, {}, false);
    Layout layout{daemon.root()};
    layout.setBuild("A1");
    ASSERT_TRUE(daemon.start());
    STWValue::Dictionary bundle, data;
    {
        auto client = daemon.connectAs("com.example.installer", migrator);
        ASSERT_NE(client, nullptr);
        bundle = STWDaemonProcess::send(*client, 0, container("com.example.app", 1));
        data = STWDaemonProcess::send(*client, 0, container("com.example.app", 2));
        ASSERT_EQ(code(bundle), STWErrorSuccess);
        ASSERT_EQ(code(data), STWErrorSuccess);
        STWValue::Dictionary cached{
            {"Entitlements", STWValue(STWValue::Dictionary{{"com.example.cached", STWValue(true)}})}};
        auto setCached = info(bundle, 1, kCachedInfoKey);
        setCached["Value"] = STWValue(cached);
        auto setGroups = info(data, 2, kGroupIDsKey);
        setGroups["Value"] = STWValue(STWValue::Array{STWValue("group.com.example")});
        ASSERT_EQ(code(STWDaemonProcess::send(*client, 5, setCached)), STWErrorSuccess);
        ASSERT_EQ(code(STWDaemonProcess::send(*client, 5, setGroups)), STWErrorSuccess);
    }
    fs::path oak;
    {
        auto client = daemon.connectAs("com.example.installer", migrator);
        oak = path(STWDaemonProcess::send(*client, 15, {{"Identifier", STWValue("com.vorlane.oak")}}));
        ASSERT_EQ(oak, layout.system() / "com.vorlane.oak");
    }
    makeOlderRelease(daemon, layout);
    struct stat before {};
    ASSERT_EQ(stat(oak.c_str(), &before), 0);
    writePlist(layout.library() / "stw_acl2_migration_complete.plist",
               {{"STWMigrationVersionNumber", STWValue("A0")}, {"STWMigrationTime", STWValue("then")}});
    STWValue::Dictionary legacyEntry{
        {"CodeSigningInfo", STWValue(STWValue::Dictionary{{"com.vorlane.Stowly.Entitlements",
                                                           STWValue(STWValue::Dictionary{})}})},
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
    // Only what the disk-log level of this (non-internal) build keeps moves; the link is
    // not followed, and the old directory goes.
    std::string moved;
    EXPECT_EQ(STWReadFileContents(layout.logs() / "stowlyd.log.1", &moved), 0);
    EXPECT_EQ(moved, "zero");
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
    fs::path bundlePath = path(STWDaemonProcess::send(*client, 0, container("com.example.app", 1, false)));
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
    STWDaemonProcess daemon({{"DeveloperMode", STWValue(true)}});
    Layout layout{daemon.root()};
    auto client = daemon.connectAs("com.example.installer", migrator);
    ASSERT_NE(client, nullptr);
    STWValue::Dictionary entitlements{{"com.vorlane.developer.default-data-protection", STWValue("complete")}};
    ASSERT_EQ(code(STWDaemonProcess::send(
                  *client, 18,
                  {{"Identifier", STWValue("com.example.orphan")},
                   {"CodeSigningInfo", STWValue(STWValue::Dictionary{
                                           {"com.vorlane.Stowly.Entitlements", STWValue(entitlements)}})}})),
              STWErrorSuccess);
    auto made = STWDaemonProcess::send(*client, 0, container("com.example.orphan", 2));
    fs::path orphan = path(made);
    ASSERT_FALSE(orphan.empty());
    auto protectionClass = [&] {
        auto reply = STWDaemonProcess::send(*client, 6, info(made, 2, kProtectionKey));
        return reply.count("ReplyInfoValue") ? reply["ReplyInfoValue"].truncatedInt64Value().value_or(-1) : -1;
    };
    auto weaken = container("com.example.orphan", 2, false);
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

// A power cut right after the bundle directory or a well-known container was renamed:
// the next start (still the first since power-on, and still an upgrade, since the build was
// not recorded) finishes the migration, and every container is found where it belongs.
TEST(STWMigrationCrash, APowerCutDuringTheBuildUpgradeLosesNoContainer) {
    STWDaemonProcess daemon({{"DeveloperMode", STWValue(true)}, {"InternalImage", STWValue(true)}});
    Layout layout{daemon.root()};
    for (std::string_view point : STWCrashPoint::migration) {
        SCOPED_TRACE(std::string(point));
        makeOlderRelease(daemon, layout);
        daemon.reboot();
        // The points lie in the start-up itself: the daemon may die there before or after
        // its socket first answers, so only the death counts.
        daemon.startWith("STOWLY_CRASH_AT", std::string(point));
        ASSERT_TRUE(daemon.killedItself());
        ASSERT_TRUE(daemon.start());
        ASSERT_TRUE(daemon.waitForCleanups(true));
        expectCurrentLayout(daemon, layout);
    }
}

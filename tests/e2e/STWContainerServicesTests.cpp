// The services on one container over the socket: info values, UUID regeneration, disk
// usage, user-managed assets, staged shared content and the retry self-test (what an app
// can plant in its containers is the hostile-app suite's, reliability/hostile).
#include "tests/e2e/STWE2ETestSupport.h"

#include "Daemon/FileSystem/STWFileManager.h"

#include <gtest/gtest.h>

#include <atomic>
#include <fcntl.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

using namespace STWE2E;

namespace {

// Creates the container and answers the keys that name it (identifier, class, UUID).
STWValue::Dictionary create(STWClient& client, const std::string& identifier, uint64_t containerClass,
                            fs::path* where = nullptr) {
    auto reply = STWDaemonProcess::send(client, 0, keys(identifier, containerClass));
    EXPECT_EQ(code(reply), STWErrorSuccess) << identifier;
    if (where)
        *where = path(reply);
    return {{"Identifier", STWValue(identifier)}, {"ContainerClass", STWValue(containerClass)}, {"UUID", reply["ReplyUUID"]}};
}

STWValue::Dictionary with(STWValue::Dictionary keys, const std::string& key, STWValue value) {
    keys[key] = std::move(value);
    return keys;
}

uint64_t diskUsage(STWClient& client, const STWValue::Dictionary& identity) {
    auto reply = STWDaemonProcess::send(client, 23, identity);
    EXPECT_EQ(code(reply), STWErrorSuccess);
    return STWDictionaryUInt64(reply, "ReplyDiskUsage").value_or(0);
}

void writeFile(const fs::path& file, size_t bytes) { write(file, std::string(bytes, 'x')); }

// A directory outside the daemon's root that links planted in containers point at.
fs::path makeCanary() {
    char templ[] = "/tmp/stowly-canary-XXXXXX";
    fs::path canary = mkdtemp(templ);
    write(canary / "secret", "root only");
    write(canary / "Caches/secret", "root only");
    return canary;
}

const STWValue::Dictionary stagingEntitlement{{"com.vorlane.private.Stowly.stageSharedContent", STWValue(true)}};
constexpr const char* kGroup = "systemgroup.com.example.shared";

STWValue::Dictionary stage(const char* group, const char* source, const char* dest) {
    return {{"Identifier", STWValue(group)}, {"SourcePath", STWValue(source)}, {"DestPath", STWValue(dest)}};
}

// The system group container kGroup and a client entitled to stage content into it.
fs::path makeSharedGroup(STWDaemonProcess& daemon, STWClient& installer, std::unique_ptr<STWClient>* stager) {
    fs::path group;
    create(installer, kGroup, 13, &group);
    STWValue::Dictionary entitlements{{"com.vorlane.security.system-groups", STWValue(STWValue::Array{STWValue(kGroup)})}};
    EXPECT_EQ(STWDaemonProcess::replyError(installer, 18, codeSigningKeys("com.example.stager", entitlements)),
              STWErrorSuccess);
    *stager = daemon.connectAs("com.example.stager", stagingEntitlement);
    return group;
}

using STWContainerServices = SharedDaemonTest;

} // namespace

// Staging checks its input, then the caller's system groups, and moves only within the group.
TEST_F(STWContainerServices, StagedSharedContentIsCheckedAndMovedWithinTheGroup) {
    std::unique_ptr<STWClient> stager;
    fs::path group = makeSharedGroup(*daemon, *client, &stager);
    auto stranger = daemon->connectAs("com.example.stranger", stagingEntitlement);
    EXPECT_EQ(STWDaemonProcess::replyError(*stranger, 26, stage("systemgroup.com.example.none", "a/../b", "c")),
              STWErrorInvalidArgument);
    EXPECT_EQ(STWDaemonProcess::replyError(*stranger, 26, stage(kGroup, "a", "b")), STWErrorNotEntitled);

    writeFile(group / "incoming/pkg/file", 10);
    auto staged = STWDaemonProcess::send(*stager, 26, stage(kGroup, "incoming/pkg", "pkg"));
    ASSERT_EQ(code(staged), STWErrorSuccess);
    EXPECT_EQ(path(staged), group / "pkg");
    EXPECT_TRUE(fs::exists(group / "pkg/file"));
    EXPECT_FALSE(fs::exists(group / "incoming/pkg"));
    EXPECT_EQ(STWDaemonProcess::replyError(*stager, 26, stage(kGroup, "incoming/pkg", "again")), STWErrorInvalidPath);
    EXPECT_EQ(STWDaemonProcess::replyError(*stager, 26, stage(kGroup, "pkg", "")), STWErrorInvalidPath);

    // A single file is staged too, and leaves the app's hands like a tree does.
    writeFile(group / "note", 10);
    ASSERT_EQ(STWDaemonProcess::replyError(*stager, 26, stage(kGroup, "note", "pkg/note")), STWErrorSuccess);
    struct stat st;
    ASSERT_EQ(lstat((group / "pkg/note").c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0707, 0u);
    EXPECT_EQ(st.st_uid, 65534u); // nobody: the private root's user database has none
}

// Info values set and removed (nil), and a regenerated UUID, survive a restart.
TEST_F(STWContainerServices, InfoValuesAndRegeneratedUUIDAreKeptOnDisk) {
    fs::path before;
    auto identity = create(*client, "com.example.info", 2, &before);
    EXPECT_EQ(code(send(5, with(with(identity, "Key", STWValue("kept")), "Value", STWValue(7u)))), STWErrorSuccess);
    EXPECT_EQ(code(send(5, with(with(identity, "Key", STWValue("gone")), "Value", STWValue("x")))), STWErrorSuccess);
    EXPECT_EQ(code(send(5, with(identity, "Key", STWValue("gone")))), STWErrorSuccess);
    EXPECT_EQ(code(send(5, with(identity, "Key", STWValue(3u)))), STWErrorInvalidArgument);
    EXPECT_EQ(code(send(9, identity)), STWErrorSuccess);

    ASSERT_TRUE(daemon->stop());
    ASSERT_TRUE(daemon->start());
    connect();
    auto kept = STWDaemonProcess::send(*client, 6, with(identity, "Key", STWValue("kept")));
    ASSERT_EQ(code(kept), STWErrorSuccess);
    EXPECT_EQ(kept["ReplyInfoValue"], STWValue(7u));
    auto gone = STWDaemonProcess::send(*client, 6, with(identity, "Key", STWValue("gone")));
    EXPECT_EQ(code(gone), STWErrorInfoValueNotFound);
    EXPECT_FALSE(gone.count("ReplyInfoValue"));
    fs::path after = path(STWDaemonProcess::send(*client, 7, identity));
    EXPECT_NE(after, before);
    EXPECT_EQ(after.parent_path(), before.parent_path());
    EXPECT_TRUE(fs::is_directory(after));
    EXPECT_FALSE(fs::exists(fs::symlink_status(before)));
}

// A bundle is measured once without fast sizing, always with it; test lock 2 parks a measurement.
TEST(STWContainerServicesInternal, DiskUsageIsCachedForBundlesAndParksBehindTestLock2) {
    for (bool fast : {false, true}) {
        SCOPED_TRACE(fast ? "fast sizing" : "no fast sizing");
        auto settings = internal;
        settings["Features"] = STWValue(STWValue::Dictionary{{"fast_container_sizing", STWValue(fast)}});
        STWDaemonProcess daemon(settings);
        auto client = daemon.connectAs("com.example.installer", allowed);
        fs::path bundle, data;
        auto bundleIdentity = create(*client, "com.example.bundle", 1, &bundle);
        auto dataIdentity = create(*client, "com.example.data", 2, &data);
        uint64_t first = diskUsage(*client, bundleIdentity);
        uint64_t firstData = diskUsage(*client, dataIdentity);
        EXPECT_GT(first, 0u);
        writeFile(bundle / "late", 1 << 20);
        writeFile(data / "late", 1 << 20);
        if (fast)
            EXPECT_GE(diskUsage(*client, bundleIdentity), first + (1 << 20));
        else
            EXPECT_EQ(diskUsage(*client, bundleIdentity), first);
        EXPECT_GE(diskUsage(*client, dataIdentity), firstData + (1 << 20));
        if (fast)
            continue;

        auto control = daemon.connectAs("com.example.tester", tester);
        ASSERT_EQ(setTestLock(*control, 2, true), STWErrorSuccess);
        std::atomic<uint64_t> parked{0};
        std::thread measure([&] {
            auto other = daemon.connectAs("com.example.installer", allowed);
            parked = STWDaemonProcess::replyError(*other, 23, dataIdentity);
        });
        std::this_thread::sleep_for(std::chrono::milliseconds(300));
        EXPECT_EQ(parked.load(), 0u);
        EXPECT_EQ(setTestLock(*control, 2, false), STWErrorSuccess);
        measure.join();
        EXPECT_EQ(parked.load(), STWErrorSuccess);
    }
}

// The assets directory is made once; only what resolves strictly inside it can be deleted.
TEST_F(STWContainerServices, UserManagedAssetsStayInsideTheirDirectory) {
    fs::path container;
    create(*client, "com.example.app", 2, &container);
    auto app = daemon->connectAs("com.example.app", {});
    STWValue::Dictionary ask{{"Identifier", STWValue("com.example.app")},
                             {"IsRelative", STWValue(true)},
                             {"CreateIfNecessary", STWValue(true)}};
    auto first = STWDaemonProcess::send(*app, 28, ask);
    ASSERT_EQ(code(first), STWErrorSuccess);
    auto second = STWDaemonProcess::send(*app, 28, ask);
    EXPECT_EQ(second["ReplyExisted"], STWValue(true));
    EXPECT_EQ(first["ReplyExisted"], STWValue(false));
    EXPECT_EQ(path(second), path(first));
    EXPECT_EQ(*path(first).begin(), "Library");
    EXPECT_EQ(STWDaemonProcess::replyError(*app, 28, with(ask, "Identifier", STWValue("com.example.other"))),
              STWErrorInvalidArgument);
    fs::path assets = container / path(first);
    struct stat st;
    ASSERT_EQ(stat(assets.c_str(), &st), 0);
    EXPECT_EQ(st.st_uid, 501u);
    EXPECT_EQ(st.st_mode & 07777, 0755u);

    fs::path canary = makeCanary();
    fs::create_symlink(canary, assets / "out");
    fs::create_directory(assets.string() + "2"); // a sibling whose name begins with the directory's
    writeFile(assets.string() + "2/file", 1);
    fs::create_symlink("../" + assets.filename().string() + "2/file", assets / "sibling");
    writeFile(assets / "doc", 10);
    auto remove = [&](const char* relative) {
        return STWDaemonProcess::replyError(*client, 29,
                                            {{"Identifier", STWValue("com.example.app")}, {"SourcePath", STWValue(relative)}});
    };
    for (const char* refused : {".", "", "out/secret", "out", "sibling", "..", "nothing"})
        EXPECT_EQ(remove(refused), STWErrorInvalidPath) << refused;
    EXPECT_EQ(remove("doc"), STWErrorSuccess);
    EXPECT_FALSE(fs::exists(assets / "doc"));
    EXPECT_TRUE(fs::is_directory(assets));
    EXPECT_TRUE(fs::exists(canary / "secret"));
    EXPECT_TRUE(fs::exists(assets.string() + "2/file"));
    STWFileManager::defaultManager()->removeItemAtURL(canary);
}

// The daemon exits N times, once per request; the next request succeeds and removes its container.
TEST(STWContainerServicesInternal, RetryTestExitsTheDaemonNTimesThenSucceeds) {
    STWDaemonProcess daemon(internal);
    for (int exits = 0; exits < 2; ++exits) {
        auto client = daemon.connectAs("com.example.tester", tester);
        EXPECT_EQ(STWDaemonProcess::replyError(*client, 25, {{"NumRetryCrashes", STWValue(2u)}}), 0u);
        EXPECT_EQ(daemon.waitForExit(std::chrono::seconds(10)), 0);
        ASSERT_TRUE(daemon.start());
    }
    auto client = daemon.connectAs("com.example.tester", tester);
    auto installer = daemon.connectAs("com.example.installer", allowed);
    auto lookup = keys("com.vorlane.retryTest", 2, false);
    EXPECT_EQ(STWDaemonProcess::replyError(*installer, 0, lookup), STWErrorSuccess);
    EXPECT_EQ(STWDaemonProcess::replyError(*client, 25, {{"NumRetryCrashes", STWValue(2u)}}), STWErrorSuccess);
    EXPECT_TRUE(daemon.isRunning());
    EXPECT_EQ(STWDaemonProcess::replyError(*installer, 0, lookup), STWErrorNotFound);
}

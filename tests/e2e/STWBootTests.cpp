// What a start repairs, with a power cycle between starts where it matters.
#include "tests/support/STWDaemonProcess.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWError.h"
#include "common/STWFormat.h"
#include "platform/STWCrashPoint.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <fstream>
#include <linux/fs.h>
#include <set>
#include <sys/ioctl.h>
#include <sys/stat.h>

namespace fs = std::filesystem;

namespace {

const STWValue::Dictionary allowed{{"com.vorlane.private.Stowly.allowed", STWValue(true)}};
const STWValue::Dictionary internal{{"DeveloperMode", STWValue(true)}, {"InternalImage", STWValue(true)}};

STWValue::Dictionary keys(const std::string& identifier, bool create = true, bool transient = false,
                          uint64_t containerClass = 2) {
    return {{"Identifier", STWValue(identifier)},
            {"ContainerClass", STWValue(containerClass)},
            {"CreateIfNecessary", STWValue(create)},
            {"Transient", STWValue(transient)}};
}
uint64_t code(const STWValue::Dictionary& reply) {
    return STWDictionaryUInt64(reply, "ReplyError").value_or(0);
}
fs::path path(const STWValue::Dictionary& reply) {
    const std::string* p = STWDictionaryString(reply, "ReplyPath");
    return p ? fs::path(*p) : fs::path();
}
std::set<std::string> names(const fs::path& directory) {
    std::set<std::string> found;
    std::error_code ec;
    for (fs::directory_iterator it(directory, ec), end; !ec && it != end; it.increment(ec))
        found.insert(it->path().filename());
    return found;
}
bool isEmpty(const fs::path& directory) {
    return names(directory).empty();
}
// Links of the sandbox mapping store whose container is gone.
std::set<std::string> staleMappings(const fs::path& root) {
    std::set<std::string> stale;
    std::error_code ec;
    for (fs::recursive_directory_iterator it(root / "run/stowly/sandbox", ec), end; !ec && it != end; it.increment(ec))
        if (it->is_symlink() && !fs::is_directory(fs::read_symlink(it->path())))
            stale.insert(it->path().filename());
    return stale;
}

struct Layout {
    fs::path root;
    fs::path live() const { return root / "private/var/mobile/Containers/Data/Application"; }
    fs::path userStaging() const { return root / "private/var/mobile/Containers/Staging"; }
    fs::path caches() const { return root / "private/var/root/Library/Caches/com.vorlane.stowlyd"; }
    fs::path deathRow() const { return caches() / "Dead"; }
    fs::path backup() const { return root / "private/var/mobile/Library/Backup/SystemContainers"; }
    fs::path journals() const { return root / "private/var/root/Library/Stowly/Replace"; }
    fs::path pendingUpdates() const { return root / "private/var/root/Library/Stowly/PendingUpdates"; }
    fs::path groups() const { return root / "private/var/mobile/Containers/Shared/AppGroup"; }
};

// Entries even root cannot remove while it lives; the flag goes before the root does.
struct AppendOnlyDirectory {
    explicit AppendOnlyDirectory(fs::path directory) : fd(open(directory.c_str(), O_RDONLY | O_DIRECTORY)) {
        set(true);
    }
    ~AppendOnlyDirectory() { set(false), close(fd); }
    void set(bool on) {
        int flags = 0;
        ioctl(fd, FS_IOC_GETFLAGS, &flags);
        flags = on ? (flags | FS_APPEND_FL) : (flags & ~FS_APPEND_FL);
        EXPECT_EQ(ioctl(fd, FS_IOC_SETFLAGS, &flags), 0);
    }
    int fd;
};

} // namespace

// Within one power-on a restart keeps transient containers, strays and backups alone and
// only sweeps staging; after a power cycle transient containers go, and so does whatever in
// a class directory is no container (a UUID directory without metadata file, a non-UUID
// name, a planted link or FIFO: moved as entries, never followed), while a directory with a
// metadata file stays and restored system containers are installed.
TEST(STWBoot, ARestartSweepsStagingAndAPowerCycleSweepsTransientsAndStrays) {
    STWDaemonProcess daemon(internal);
    Layout layout{daemon.root()};
    ASSERT_TRUE(daemon.waitForCleanups(true));
    auto client = daemon.connectAs("com.example.installer", allowed);
    ASSERT_NE(client, nullptr);
    fs::path live = path(STWDaemonProcess::send(*client, 0, keys("com.example.live")));
    fs::path transient = path(STWDaemonProcess::send(*client, 0, keys("com.example.tmp", true, true)));
    ASSERT_TRUE(daemon.stop());

    fs::path outside = daemon.root() / "outside";
    fs::create_directories(outside / "kept");
    std::string orphan = STWUUID::random().string(), withMetadata = STWUUID::random().string(),
                link = STWUUID::random().string(), fifo = STWUUID::random().string();
    fs::create_directories(layout.live() / orphan / "Documents");
    fs::create_directories(layout.live() / withMetadata);
    std::ofstream(layout.live() / withMetadata / ".com.vorlane.stowly.metadata.plist") << "unread";
    fs::create_directories(layout.live() / "not-a-uuid");
    fs::create_directory_symlink(outside, layout.live() / link);
    ASSERT_EQ(mkfifo((layout.live() / fifo).c_str(), 0600), 0);
    fs::create_directories(layout.userStaging() / "interrupted/Library");
    fs::create_directories(layout.caches() / "Staging/interrupted-global");
    fs::create_directory_symlink(outside, layout.userStaging() / "planted");
    fs::create_directories(layout.backup() / "Data/com.example.restored/Library");
    std::set<std::string> planted{live.filename(), orphan, withMetadata, "not-a-uuid", link, fifo};
    // A journal and an update file whose writes a stop cut short before their renames.
    for (fs::path markers : {layout.journals(), layout.pendingUpdates()}) {
        fs::create_directories(markers);
        std::ofstream(markers / ".interrupted.plist.Ab12Cd") << "half";
    }
    // The journal of a replace that failed only to remove it (a full disk), whose container
    // was deleted since: old path, destination and staging are all gone. Recovery must drop
    // it instead of failing on it at every start.
    {
        auto gone = [&](const fs::path& directory) { return (directory / STWUUID::random().string()).string(); };
        std::ofstream(layout.journals() / (STWUUID::random().string() + ".plist"))
            << "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
            << "<key>STWReplaceOperationOldURL</key><string>" << gone(layout.live()) << "</string>"
            << "<key>STWReplaceOperationNewURL</key><string>" << gone(layout.live()) << "</string>"
            << "<key>STWReplaceOperationStagingURL</key><string>" << gone(layout.userStaging()) << "</string>"
            << "<key>STWReplaceOperationDestURL</key><string>" << gone(layout.live()) << "</string>"
            << "</dict></plist>\n";
    }

    ASSERT_TRUE(daemon.start());
    ASSERT_TRUE(daemon.waitForCleanups());
    EXPECT_TRUE(isEmpty(layout.journals()));
    EXPECT_TRUE(isEmpty(layout.pendingUpdates()));
    EXPECT_TRUE(isEmpty(layout.userStaging()));
    EXPECT_TRUE(isEmpty(layout.caches() / "Staging"));
    EXPECT_TRUE(fs::is_directory(transient));
    EXPECT_EQ(names(layout.live()), planted);
    EXPECT_TRUE(fs::is_directory(layout.backup() / "Data/com.example.restored")) << "nothing installed";
    ASSERT_TRUE(daemon.stop());

    daemon.reboot();
    ASSERT_TRUE(daemon.start());
    ASSERT_TRUE(daemon.waitForCleanups(true));
    EXPECT_FALSE(fs::exists(transient));
    EXPECT_EQ(names(layout.live()), (std::set<std::string>{live.filename(), withMetadata}));
    EXPECT_TRUE(fs::is_directory(outside / "kept")) << "no link was followed";
    EXPECT_TRUE(isEmpty(layout.deathRow()));
    client = daemon.connectAs("com.example.installer", allowed);
    EXPECT_EQ(path(STWDaemonProcess::send(*client, 0, keys("com.example.live", false))), live);
    auto restored = STWDaemonProcess::send(*client, 0, keys("com.example.restored", false, false, 12));
    ASSERT_EQ(code(restored), STWErrorSuccess);
    EXPECT_TRUE(fs::is_directory(path(restored) / "Library"));
}

// The backup is renamed to "inprogress" (replacing a stale one) and installed item by item;
// an item that cannot replace the live one is kept in the failed-items directory while the
// others are installed. A stale "inprogress" without a new backup is left alone.
TEST(STWBoot, RestoredSystemContainersAreInstalledThroughInprogress) {
    STWDaemonProcess daemon(internal);
    Layout layout{daemon.root()};
    auto client = daemon.connectAs("com.example.installer", allowed);
    ASSERT_NE(client, nullptr);
    fs::path system = path(STWDaemonProcess::send(*client, 0, keys("com.example.sys", true, false, 12)));
    ASSERT_FALSE(system.empty());
    fs::create_directories(system / "Locked");
    std::ofstream(system / "Locked/old") << "old";
    std::ofstream(system / "Replaced") << "old";
    AppendOnlyDirectory locked(system / "Locked");
    ASSERT_TRUE(daemon.stop());

    fs::create_directories(layout.backup() / "Data/com.example.sys/Locked");
    std::ofstream(layout.backup() / "Data/com.example.sys/Locked/new") << "new";
    std::ofstream(layout.backup() / "Data/com.example.sys/Replaced") << "new";
    fs::create_directories(layout.backup() / "Data/com.example.other/Added");
    fs::create_directories(layout.backup() / "Data.inprogress/stale");
    fs::create_directories(layout.backup() / "Shared.inprogress/stale");
    daemon.reboot();
    ASSERT_TRUE(daemon.start());
    client = daemon.connectAs("com.example.installer", allowed);
    std::string text;
    std::ifstream(system / "Replaced") >> text;
    EXPECT_EQ(text, "new");
    EXPECT_EQ(names(system / "Locked"), std::set<std::string>{"old"});
    EXPECT_TRUE(fs::exists(layout.backup() / "Data.inprogress.failed/com.example.sys/Locked/new"));
    auto other = STWDaemonProcess::send(*client, 0, keys("com.example.other", false, false, 12));
    ASSERT_EQ(code(other), STWErrorSuccess);
    EXPECT_TRUE(fs::is_directory(path(other) / "Added"));
    EXPECT_FALSE(fs::exists(layout.backup() / "Data"));
    EXPECT_FALSE(fs::exists(layout.backup() / "Data.inprogress/stale"));
    EXPECT_TRUE(fs::exists(layout.backup() / "Shared.inprogress/stale"));
}

// The crash points of creation, deletion, death row, replace, protection changes and
// code-signing updates, one after the other on one root: after each killed daemon the next
// start and its cleanups leave only whole containers in the class directory, nothing in
// staging, death row, the replace journals or the pending protection changes, no group
// container that no entry names and no sandbox mapping of a container that is gone, and
// every acknowledged container is found.
TEST(STWBootCrash, EveryCrashPointIsRepairedByTheNextStart) {
    STWDaemonProcess daemon(internal);
    Layout layout{daemon.root()};
    std::set<std::string> acknowledged;
    unsigned n = 0;
    for (std::string_view point : STWCrashPoint::all) {
        // Only a build upgrade reaches those (STWMigrationTests).
        if (point.starts_with("migration."))
            continue;
        SCOPED_TRACE(std::string(point));
        ASSERT_TRUE(daemon.stop());
        // A code-signing update first names a group, which is made, and is killed when the
        // next update drops it.
        bool codeSigning = point.starts_with("codesigning.");
        ASSERT_TRUE(daemon.startWith("STOWLY_CRASH_AT", std::string(point) + (codeSigning ? ":2" : "")));
        auto client = daemon.connectAs("com.example.installer", allowed);
        ASSERT_NE(client, nullptr);
        std::string identifier = STWFormat("com.example.c%u", ++n);
        auto made = STWDaemonProcess::send(*client, 0, keys(identifier));
        if (code(made) == STWErrorSuccess)
            acknowledged.insert(identifier);
        if (point == STWCrashPoint::deathRowAfterTemporaryDirectory) {
            // A transient container asked for again retires the old one to death row.
            STWDaemonProcess::send(*client, 0, keys(identifier, true, true));
            STWDaemonProcess::send(*client, 0, keys(identifier, true, true));
        } else if (point.starts_with("delete.") || point.starts_with("deathrow.")) {
            acknowledged.erase(identifier);
            STWDaemonProcess::send(*client, 10, keys(identifier));
            STWDaemonProcess::send(*client, 4, {});
        } else if (point.starts_with("replace.")) {
            auto fresh = STWDaemonProcess::send(*client, 0, keys(identifier, true, true));
            STWDaemonProcess::send(*client, 2,
                                   {{"OldIdentifier", STWValue(identifier)},
                                    {"OldContainerClass", STWValue(2)},
                                    {"OldContainerUUID", made["ReplyUUID"]},
                                    {"NewIdentifier", STWValue(identifier)},
                                    {"NewContainerClass", STWValue(2)},
                                    {"NewContainerUUID", fresh["ReplyUUID"]}});
        } else if (point.starts_with("protection.")) {
            STWValue::Dictionary message = keys(identifier, false);
            message["Command"] = STWValue(21u);
            message["DataProtectionClass"] = STWValue(int64_t{1});
            client->sendMessage(message, std::chrono::seconds(5), nullptr);
        } else if (codeSigning) {
            auto entry = [&](STWValue::Array groups) {
                STWValue::Dictionary entitlements{{"com.vorlane.security.application-groups", STWValue(groups)}};
                return STWValue::Dictionary{
                    {"Identifier", STWValue(identifier)},
                    {"CodeSigningInfo", STWValue(STWValue::Dictionary{
                                            {"com.vorlane.Stowly.Entitlements", STWValue(entitlements)}})}};
            };
            ASSERT_EQ(STWDaemonProcess::replyError(*client, 18, entry({STWValue("group.example.dropped")})),
                      STWErrorSuccess);
            ASSERT_EQ(STWDaemonProcess::replyError(*client, 13, {{"Identifier", STWValue(identifier)}}),
                      STWErrorSuccess);
            ASSERT_FALSE(isEmpty(layout.groups()));
            STWDaemonProcess::send(*client, 18, entry({}));
        }
        ASSERT_TRUE(daemon.killedItself());

        ASSERT_TRUE(daemon.start());
        ASSERT_TRUE(daemon.waitForCleanups());
        for (const auto& entry : names(layout.live()))
            EXPECT_TRUE(fs::exists(layout.live() / entry / ".com.vorlane.stowly.metadata.plist")) << entry;
        EXPECT_TRUE(isEmpty(layout.userStaging()));
        EXPECT_TRUE(isEmpty(layout.caches() / "Staging"));
        EXPECT_TRUE(isEmpty(layout.deathRow()));
        EXPECT_TRUE(isEmpty(daemon.root() / "private/var/root/Library/Stowly/Replace"));
        EXPECT_TRUE(isEmpty(daemon.root() / "private/var/root/Library/Stowly/PendingUpdates"));
        EXPECT_TRUE(isEmpty(layout.groups()));
        client = daemon.connectAs("com.example.installer", allowed);
        for (const auto& found : acknowledged)
            EXPECT_EQ(code(STWDaemonProcess::send(*client, 0, keys(found, false))), STWErrorSuccess) << found;
        EXPECT_EQ(staleMappings(daemon.root()), std::set<std::string>());
    }
}

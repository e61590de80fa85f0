// What a start repairs, with a power cycle where it matters (after a kill: scripts/torture).
#include "tests/e2e/STWE2ETestSupport.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>

using namespace STWE2E;

namespace {

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

// A restart sweeps only staging and half-written files; a power cycle also sweeps transient
// containers and whatever in a class directory is no container (links and FIFOs moved as
// entries, never followed), keeps what has a metadata file and installs restored system
// containers through "inprogress" (replacing a stale one): an item that cannot replace the
// live one is kept in the failed-items directory, and a stale "inprogress" alone stays.
TEST(STWBoot, ARestartSweepsStagingAndAPowerCycleSweepsStraysAndInstallsBackups) {
    STWDaemonProcess daemon(internal);
    Layout layout{daemon.root()};
    ASSERT_TRUE(daemon.waitForCleanups(true));
    auto client = daemon.connectAs("com.example.installer", allowed);
    ASSERT_NE(client, nullptr);
    fs::path live = path(STWDaemonProcess::send(*client, 0, keys("com.example.live")));
    fs::path transient = path(STWDaemonProcess::send(*client, 0, keys("com.example.tmp", 2, true, true)));
    fs::path system = path(STWDaemonProcess::send(*client, 0, keys("com.example.sys", 12)));
    ASSERT_FALSE(system.empty());
    write(system / "Locked/old", "old");
    write(system / "Replaced", "old");
    AppendOnlyDirectory locked(system / "Locked");
    ASSERT_TRUE(daemon.stop());

    fs::path outside = daemon.root() / "outside";
    fs::create_directories(outside / "kept");
    std::string orphan = STWUUID::random().string(), withMetadata = STWUUID::random().string(),
                link = STWUUID::random().string(), fifo = STWUUID::random().string();
    fs::create_directories(layout.live() / orphan / "Documents");
    write(layout.live() / withMetadata / ".com.vorlane.stowly.metadata.plist", "unread");
    fs::create_directories(layout.live() / "not-a-uuid");
    fs::create_directory_symlink(outside, layout.live() / link);
    ASSERT_EQ(mkfifo((layout.live() / fifo).c_str(), 0600), 0);
    fs::create_directories(layout.userStaging() / "interrupted/Library");
    fs::create_directories(layout.caches() / "Staging/interrupted-global");
    fs::create_directory_symlink(outside, layout.userStaging() / "planted");
    std::set<std::string> planted{live.filename(), orphan, withMetadata, "not-a-uuid", link, fifo};
    // A journal and an update file whose writes a stop cut short before their renames.
    write(layout.journals() / ".interrupted.plist.Ab12Cd", "half");
    write(layout.pendingUpdates() / ".interrupted.plist.Ab12Cd", "half");
    fs::create_directories(layout.backup() / "Data/com.example.restored/Library");
    write(layout.backup() / "Data/com.example.sys/Locked/new", "new");
    write(layout.backup() / "Data/com.example.sys/Replaced", "new");
    fs::create_directories(layout.backup() / "Data.inprogress/stale");
    fs::create_directories(layout.backup() / "Shared.inprogress/stale");

    ASSERT_TRUE(daemon.start());
    ASSERT_TRUE(daemon.waitForCleanups());
    for (fs::path swept :
         {layout.journals(), layout.pendingUpdates(), layout.userStaging(), layout.caches() / "Staging"})
        EXPECT_EQ(names(swept), std::set<std::string>()) << swept;
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
    EXPECT_EQ(names(layout.deathRow()), std::set<std::string>());
    client = daemon.connectAs("com.example.installer", allowed);
    EXPECT_EQ(path(STWDaemonProcess::send(*client, 0, keys("com.example.live", 2, false))), live);
    auto restored = STWDaemonProcess::send(*client, 0, keys("com.example.restored", 12, false));
    ASSERT_EQ(code(restored), STWErrorSuccess);
    EXPECT_TRUE(fs::is_directory(path(restored) / "Library"));
    EXPECT_EQ(read(system / "Replaced"), "new");
    EXPECT_EQ(names(system / "Locked"), std::set<std::string>{"old"});
    EXPECT_TRUE(fs::exists(layout.backup() / "Data.inprogress.failed/com.example.sys/Locked/new"));
    EXPECT_FALSE(fs::exists(layout.backup() / "Data"));
    EXPECT_FALSE(fs::exists(layout.backup() / "Data.inprogress/stale"));
    EXPECT_TRUE(fs::exists(layout.backup() / "Shared.inprogress/stale"));
}

// Apps attack the daemon from the directories they own. There is no sandbox around an app
// here: it runs as its user (501), owns its containers and the per-user class and staging
// directories, and may rename, link or replace anything in them while the daemon works
// there. Root plays the app below, doing only what user 501 could do in those directories.
#include "tests/support/STWDaemonProcess.h"

#include "Daemon/FileSystem/STWFileManager.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWError.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <fcntl.h>
#include <fstream>
#include <map>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <thread>
#include <unistd.h>

namespace fs = std::filesystem;

namespace {

const STWValue::Dictionary allowed{{"com.vorlane.private.Stowly.allowed", STWValue(true)}};
constexpr const char* kMetadataName = ".com.vorlane.stowly.metadata.plist";

STWValue::Dictionary keys(const std::string& identifier, uint64_t containerClass, bool create = true) {
    return {{"Identifier", STWValue(identifier)},
            {"ContainerClass", STWValue(containerClass)},
            {"CreateIfNecessary", STWValue(create)}};
}

fs::path pathOf(const STWValue::Dictionary& reply) {
    const std::string* p = STWDictionaryString(reply, "ReplyPath");
    return p ? fs::path(*p) : fs::path();
}

uint64_t codeOf(const STWValue::Dictionary& reply) { return STWDictionaryUInt64(reply, "ReplyError").value_or(0); }

// Everything root could have changed in a tree: each entry's type, mode, owner, protection
// class and contents (or link target); only the directories with `directoriesOnly` (the
// daemon's own library, whose log files change as it runs).
std::map<std::string, std::string> snapshot(const fs::path& root, bool directoriesOnly = false) {
    std::map<std::string, std::string> entries;
    auto record = [&](const fs::path& path) {
        struct stat st;
        if (lstat(path.c_str(), &st) != 0 || (directoriesOnly && !S_ISDIR(st.st_mode)))
            return;
        std::string state = std::to_string(st.st_mode) + ":" + std::to_string(st.st_uid) + ":" + std::to_string(st.st_gid);
        char value[16] = {};
        if (lgetxattr(path.c_str(), "trusted.stowly.protection-class", value, sizeof value) >= 0)
            state += ":class";
        char acl[256];
        for (const char* name : {"system.posix_acl_access", "system.posix_acl_default"}) {
            ssize_t n = lgetxattr(path.c_str(), name, acl, sizeof acl);
            state += ":" + std::string(acl, n > 0 ? static_cast<size_t>(n) : 0);
        }
        if (S_ISREG(st.st_mode))
            state += ":" + std::string(std::istreambuf_iterator<char>(std::ifstream(path).rdbuf()), {});
        else if (S_ISLNK(st.st_mode))
            state += ":" + fs::read_symlink(path).string();
        entries[path.lexically_relative(root.parent_path()).string()] = state;
    };
    record(root);
    std::error_code ec;
    for (fs::recursive_directory_iterator it(root, ec), end; !ec && it != end; it.increment(ec))
        record(it->path());
    return entries;
}

// A directory outside the daemon's root, with the names an attack aims at.
fs::path makeCanary() {
    char templ[] = "/tmp/stowly-canary-XXXXXX";
    fs::path canary = mkdtemp(templ);
    fs::create_directories(canary / "Caches");
    fs::permissions(canary / "Caches", fs::perms(0700));
    std::ofstream(canary / "Caches/secret") << "root only";
    return canary;
}

class STWHostileAppTest : public ::testing::Test {
protected:
    void SetUp() override {
        daemon = std::make_unique<STWDaemonProcess>(STWValue::Dictionary{{"DeveloperMode", STWValue(true)}});
        installer = daemon->connectAs("com.example.installer", allowed);
        ASSERT_NE(installer, nullptr);
        canary = makeCanary();
    }
    void TearDown() override {
        installer.reset();
        daemon.reset();
        STWFileManager::defaultManager()->removeItemAtURL(canary);
    }

    // Creates the container; its identity for the commands that name a concrete container
    // goes to `identity`.
    fs::path create(const std::string& identifier, uint64_t containerClass = 2,
                    STWValue::Dictionary* identity = nullptr) {
        auto reply = STWDaemonProcess::send(*installer, 0, keys(identifier, containerClass));
        EXPECT_EQ(codeOf(reply), STWErrorSuccess) << identifier;
        if (identity && reply.count("ReplyUUID"))
            *identity = {{"Identifier", STWValue(identifier)},
                         {"ContainerClass", STWValue(containerClass)},
                         {"UUID", reply["ReplyUUID"]}};
        return pathOf(reply);
    }
    // The app swaps its container for a directory of its own making that holds `metadata`.
    static void plantContainer(const fs::path& container, const std::function<void(const fs::path&)>& metadata) {
        fs::rename(container, container.string() + ".away");
        fs::create_directory(container);
        metadata(container / kMetadataName);
        chown(container.c_str(), 501, 501);
    }

    std::unique_ptr<STWDaemonProcess> daemon;
    std::unique_ptr<STWClient> installer;
    fs::path canary;
};

// A subdirectory of the container swapped, in a loop, with a link to a directory outside it
// (also the daemon's own library): nothing outside the container changes. In a system
// container, recreating the structure walks the whole container to set its ACLs.
TEST_F(STWHostileAppTest, SubdirectorySwappedForALinkNeverLeadsOutOfTheContainer) {
    for (uint64_t containerClass : {2u, 12u}) {
        STWValue::Dictionary identity;
        fs::path container = create("com.example.swapper", containerClass, &identity);
        fs::path ownLibrary = daemon->root() / "private/var/root/Library";
        ASSERT_TRUE(fs::is_directory(ownLibrary));
        auto before = snapshot(canary), ownBefore = snapshot(ownLibrary, true);
        std::atomic<bool> done{false};
        std::thread app([&] {
            fs::create_symlink(canary, container / "toCanary");
            fs::create_symlink(ownLibrary, container / "toOwn");
            mkfifo((container / "fifo").c_str(), 0600);
            fs::create_symlink("loop", container / "loop");
            for (unsigned i = 0; !done; ++i)
                renameat2(AT_FDCWD, (container / "Library").c_str(), AT_FDCWD,
                          (container / (i % 4 < 2 ? "toCanary" : "toOwn")).c_str(), RENAME_EXCHANGE);
        });
        for (int i = 0; i < 300; ++i)
            STWDaemonProcess::send(*installer, i % 2 ? 8 : 22, identity);
        done = true;
        app.join();
        EXPECT_EQ(snapshot(canary), before) << "class " << containerClass;
        EXPECT_EQ(snapshot(ownLibrary, true), ownBefore) << "class " << containerClass;
    }
}

// The container replaced by a link to a system group container: no command re-owns or fills
// that container, and no look-up hands out the link.
TEST_F(STWHostileAppTest, ContainerReplacedByALinkIsNoLongerThatContainer) {
    fs::path system = create("systemgroup.com.example.shared", 13);
    STWValue::Dictionary identity;
    fs::path container = create("com.example.squatter", 2, &identity);
    ASSERT_FALSE(system.empty());
    auto before = snapshot(system);
    fs::rename(container, container.string() + ".away");
    fs::create_symlink(system, container);
    for (uint64_t command : {0u, 7u, 8u, 22u}) {
        auto request = identity;
        request["CreateIfNecessary"] = STWValue(command == 0);
        auto reply = STWDaemonProcess::send(*installer, command, request);
        if (codeOf(reply) == STWErrorSuccess && reply.count("ReplyPath")) {
            EXPECT_FALSE(fs::is_symlink(pathOf(reply))) << "command " << command;
        }
    }
    EXPECT_EQ(snapshot(system), before);
}

// Every new staging entry replaced by a link to a directory outside: no link is published as
// a container, and nothing is written where the links point.
TEST_F(STWHostileAppTest, StagingEntriesReplacedByLinksAreNeverPublished) {
    fs::path first = create("com.example.stager.0");
    fs::path classDirectory = first.parent_path();
    fs::path staging = classDirectory.parent_path().parent_path() / "Staging";
    ASSERT_TRUE(fs::is_directory(staging));
    auto before = snapshot(canary);
    int watch = inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
    ASSERT_GE(inotify_add_watch(watch, staging.c_str(), IN_CREATE | IN_ONLYDIR), 0);
    std::atomic<bool> done{false};
    std::thread app([&] {
        alignas(inotify_event) char buffer[8192];
        while (!done) {
            ssize_t n = read(watch, buffer, sizeof buffer);
            for (ssize_t at = 0; at < n;) {
                auto* event = reinterpret_cast<inotify_event*>(buffer + at);
                fs::path entry = staging / event->name;
                if (event->len && rename(entry.c_str(), (entry.string() + ".x").c_str()) == 0)
                    symlink(canary.c_str(), entry.c_str());
                at += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
            }
        }
    });
    for (int i = 1; i < 60; ++i)
        STWDaemonProcess::send(*installer, 0, keys("com.example.stager." + std::to_string(i), 2));
    done = true;
    app.join();
    close(watch);
    EXPECT_EQ(snapshot(canary), before);
    for (const auto& entry : fs::directory_iterator(classDirectory))
        EXPECT_FALSE(fs::is_symlink(entry.symlink_status())) << entry.path();
}

// The user owns the directory above its class and staging directories, so an app can put
// links there in place of "Data" and "Staging": creation then neither publishes nor builds
// anything where they point.
TEST_F(STWHostileAppTest, LinksAboveTheClassDirectoryLeadNowhere) {
    fs::path base = create("com.example.first").parent_path().parent_path().parent_path(); // Containers
    fs::create_directories(canary / "Application");
    auto before = snapshot(canary);
    fs::rename(base / "Data", base / "Data.away");
    fs::rename(base / "Staging", base / "Staging.away");
    fs::create_directory_symlink(canary, base / "Data");
    fs::create_directory_symlink(canary, base / "Staging");
    for (int i = 0; i < 3; ++i)
        STWDaemonProcess::send(*installer, 0, keys("com.example.redirected" + std::to_string(i), 2));
    EXPECT_EQ(snapshot(canary), before);
}

// Apps copy a victim's metadata into directories of their own; after a restart the victim's
// look-up still answers the victim's container.
TEST_F(STWHostileAppTest, CopiedMetadataTakesNothingOver) {
    fs::path victim = create("com.example.victim");
    for (int i = 0; i < 15; ++i)
        plantContainer(create("com.example.thief" + std::to_string(i)), [&](const fs::path& file) {
            fs::copy_file(victim / kMetadataName, file);
            chown(file.c_str(), 501, 501);
        });
    for (int run = 0; run < 2; ++run) {
        ASSERT_TRUE(daemon->stop());
        ASSERT_TRUE(daemon->start());
        auto client = daemon->connectAs("com.example.victim", {});
        auto reply = STWDaemonProcess::send(*client, 0, keys("com.example.victim", 2, false));
        EXPECT_EQ(pathOf(reply), victim);
    }
}

// A FIFO, a link loop or an oversized file in place of the metadata of several classes: the
// first look-ups after a restart answer at once, and the daemon still stops on SIGTERM.
TEST_F(STWHostileAppTest, FifosAndLoopsInContainersFreezeNothing) {
    const std::pair<const char*, uint64_t> targets[] = {{"com.example.fifo", 2},
                                                        {"group.com.example.fifo", 7},
                                                        {"systemgroup.com.example.fifo", 13}};
    for (const auto& [identifier, containerClass] : targets) {
        plantContainer(create(identifier, containerClass),
                       [](const fs::path& file) { ASSERT_EQ(mkfifo(file.c_str(), 0644), 0); });
    }
    plantContainer(create("com.example.loop"), [](const fs::path& file) { fs::create_symlink(file, file); });
    plantContainer(create("com.example.huge"), [](const fs::path& file) {
        std::ofstream{file};
        fs::resize_file(file, 64 << 20);
    });
    ASSERT_TRUE(daemon->stop());
    ASSERT_TRUE(daemon->start());
    for (const auto& [identifier, containerClass] : targets) {
        auto client = daemon->connectAs("com.example.installer", allowed);
        STWErrorRef error;
        auto message = keys(identifier, containerClass, false);
        message["Command"] = STWValue(0);
        auto reply = client->sendMessage(message, std::chrono::seconds(1), &error);
        ASSERT_TRUE(reply) << identifier << ": " << (error ? error->description() : "");
        EXPECT_EQ(codeOf(*reply), STWErrorNotFound);
    }
    auto start = std::chrono::steady_clock::now();
    EXPECT_TRUE(daemon->stop());
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(10));
}

} // namespace

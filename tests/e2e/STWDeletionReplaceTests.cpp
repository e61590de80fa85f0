// Containers leaving and changing places over the socket: deletion through death row,
// wipes, replaces, and what a start finds after a daemon was killed in the middle of one.
#include "tests/support/STWDaemonProcess.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWError.h"
#include "common/STWFileIO.h"
#include "platform/STWCrashPoint.h"

#include <gtest/gtest.h>

#include <fstream>

namespace fs = std::filesystem;

namespace {

const STWValue::Dictionary allowed{{"com.vorlane.private.Stowly.allowed", STWValue(true)}};

STWValue::Dictionary keys(const std::string& identifier, bool create = true, bool transient = false,
                          uint64_t containerClass = 2) {
    return {{"Identifier", STWValue(identifier)},
            {"ContainerClass", STWValue(containerClass)},
            {"CreateIfNecessary", STWValue(create)},
            {"Transient", STWValue(transient)}};
}

uint64_t code(const STWValue::Dictionary& reply) { return STWDictionaryUInt64(reply, "ReplyError").value_or(0); }
fs::path path(const STWValue::Dictionary& reply) {
    const std::string* p = STWDictionaryString(reply, "ReplyPath");
    return p ? fs::path(*p) : fs::path();
}
STWUUID uuid(const STWValue::Dictionary& reply) {
    const STWValue* v = STWDictionaryFind(reply, "ReplyUUID");
    return v && v->uuid() ? *v->uuid() : STWUUID{};
}

// Visible entries of a directory (none when it does not exist).
size_t count(const fs::path& directory) {
    size_t n = 0;
    std::error_code ec;
    for (fs::directory_iterator it(directory, ec), end; !ec && it != end; it.increment(ec))
        n += it->path().filename().native()[0] != '.';
    return n;
}

void write(const fs::path& file, const std::string& text) { std::ofstream(file) << text; }
std::string read(const fs::path& file) {
    std::string text;
    return STWReadFileContents(file, &text, 0) == 0 ? text : std::string("<missing>");
}

struct Layout {
    fs::path root;
    fs::path live() const { return root / "private/var/mobile/Containers/Data/Application"; }
    fs::path deathRow() const { return root / "private/var/root/Library/Caches/com.vorlane.stowlyd/Dead"; }
    fs::path journals() const { return root / "private/var/root/Library/Stowly/Replace"; }
};

STWValue::Dictionary replaceKeys(const std::string& identifier, const STWValue::Dictionary& oldReply,
                                 const STWValue::Dictionary& newReply) {
    STWValue::Dictionary k{{"NewIdentifier", STWValue(identifier)},
                           {"NewContainerClass", STWValue(2)},
                           {"NewContainerUUID", STWValue(uuid(newReply))}};
    if (!oldReply.empty()) {
        k["OldIdentifier"] = STWValue(identifier);
        k["OldContainerClass"] = STWValue(2);
        k["OldContainerUUID"] = STWValue(uuid(oldReply));
    }
    return k;
}

// Stage-for-delete of class 2 containers of the caller's persona, as `reply` names it.
STWValue::Dictionary stageKeys(std::vector<STWUUID> uuids, const std::string& identifier,
                               const STWValue::Dictionary& reply) {
    const std::string* persona = STWDictionaryString(reply, "ReplyPersonaUniqueString");
    STWValue::Array classes, ids, personas, values;
    for (const auto& u : uuids) {
        classes.emplace_back(uint64_t{2});
        ids.emplace_back(identifier);
        personas.emplace_back(persona ? *persona : std::string());
        values.emplace_back(u);
    }
    return {{"ContainerClassesArray", STWValue(classes)},
            {"UUIDsArray", STWValue(values)},
            {"IdentifiersArray", STWValue(ids)},
            {"PersonaUniqueStringsArray", STWValue(personas)}};
}

class STWDeletionReplaceTest : public ::testing::Test {
protected:
    void SetUp() override {
        daemon = std::make_unique<STWDaemonProcess>(STWValue::Dictionary{{"DeveloperMode", STWValue(true)}});
        layout.root = daemon->root();
        client = daemon->connectAs(
            "com.example.installer",
            {{"com.vorlane.private.Stowly.allowed", STWValue(true)},
             {"com.vorlane.private.Stowly.deleteContainerContent", STWValue(true)},
             {"com.vorlane.private.Stowly.userManagedAssets", STWValue(true)},
             {"com.vorlane.private.Stowly.wipeContainer", STWValue(STWValue::Array{STWValue("com.example.plugin")})}});
        ASSERT_NE(client, nullptr);
    }
    STWValue::Dictionary send(uint64_t command, STWValue::Dictionary k) {
        return STWDaemonProcess::send(*client, command, std::move(k));
    }
    std::unique_ptr<STWDaemonProcess> daemon;
    std::unique_ptr<STWClient> client;
    Layout layout;
};

} // namespace

TEST_F(STWDeletionReplaceTest, ADeletedContainerLeavesByDeathRow) {
    auto made = send(0, keys("com.example.gone"));
    ASSERT_EQ(code(made), STWErrorSuccess);
    write(path(made) / "note", "x");
    EXPECT_EQ(code(send(10, {{"ContainerClass", STWValue(2)}})), STWErrorNoIdentifier) << "no fallback to the caller";
    EXPECT_EQ(code(send(10, keys("com.example.gone"))), STWErrorSuccess);
    EXPECT_FALSE(fs::exists(path(made)));
    EXPECT_EQ(read(layout.deathRow() / path(made).filename() / "note"), "x");
    EXPECT_EQ(code(send(0, keys("com.example.gone", false))), STWErrorNotFound);
    EXPECT_EQ(code(send(10, keys("com.example.gone"))), STWErrorNotFound);
    EXPECT_EQ(code(send(4, {})), STWErrorSuccess) << "the reply waits for the pass";
    EXPECT_EQ(count(layout.deathRow()), 0u);
}

// Stage-for-delete by UUID. Counts that differ queue nothing; an unknown UUID does not keep
// the next one from going. A container the app moved away, or replaced with a link to a
// directory elsewhere, leaves the cache, and nothing but the container itself is touched.
TEST_F(STWDeletionReplaceTest, StagingTouchesOnlyTheContainersOwnDirectory) {
    auto a = send(0, keys("com.example.a")), b = send(0, keys("com.example.b")), c = send(0, keys("com.example.c"));
    ASSERT_EQ(code(a), STWErrorSuccess);
    auto mismatched = stageKeys({uuid(a), uuid(b)}, "com.example.a", a);
    mismatched["PersonaUniqueStringsArray"] = STWValue(STWValue::Array{STWValue("")});
    EXPECT_EQ(code(send(3, mismatched)), STWErrorInvalidArgument);
    EXPECT_TRUE(fs::exists(path(a)));

    EXPECT_EQ(code(send(3, stageKeys({STWUUID::random(), uuid(a)}, "com.example.a", a))), STWErrorSuccess);
    EXPECT_FALSE(fs::exists(path(a)));
    EXPECT_EQ(code(send(0, keys("com.example.a", false))), STWErrorNotFound);

    fs::path outside = layout.root / "outside";
    fs::create_directories(outside);
    write(outside / "precious", "p");
    fs::rename(path(b), layout.root / "b-moved");
    fs::create_directory_symlink(outside, path(b));
    fs::rename(path(c), layout.root / "c-moved");
    fs::create_directory(path(c));
    write(path(c) / "precious", "p");
    EXPECT_EQ(code(send(3, stageKeys({uuid(b)}, "com.example.b", b))), STWErrorSuccess);
    EXPECT_EQ(code(send(3, stageKeys({uuid(c)}, "com.example.c", c))), STWErrorSuccess);
    EXPECT_EQ(read(outside / "precious"), "p");
    EXPECT_EQ(read(path(c) / "precious"), "p");
    EXPECT_TRUE(fs::is_symlink(path(b)));
    // Dropped by the command, not by a look-up that found the metadata gone (44).
    EXPECT_EQ(code(send(0, keys("com.example.b", false))), STWErrorNotFound);
    EXPECT_EQ(code(send(0, keys("com.example.c", false))), STWErrorNotFound);
}

// A wipe keeps path and UUID, also after a restart, and empties the container; its old
// content goes to death row. Without the right to wipe any container, only the listed
// identifiers of class 4 may be wiped.
TEST_F(STWDeletionReplaceTest, AWipeKeepsPathAndUUIDAndEmptiesTheContainer) {
    auto made = send(0, keys("com.example.wiped"));
    write(path(made) / "note", "x");
    ASSERT_EQ(code(send(12, {{"Identifier", STWValue("com.example.wiped")}, {"ContainerClass", STWValue(2)}})),
              STWErrorSuccess);
    EXPECT_FALSE(fs::exists(path(made) / "note"));
    EXPECT_TRUE(fs::is_directory(path(made) / "Library/Caches"));
    EXPECT_EQ(count(layout.journals()), 0u);
    ASSERT_TRUE(daemon->stop() && daemon->start());
    client = daemon->connectAs("com.example.installer", allowed);
    auto found = send(0, keys("com.example.wiped", false));
    EXPECT_EQ(path(found), path(made));
    EXPECT_EQ(uuid(found), uuid(made));

    auto wiper = daemon->connectAs(
        "com.example.wiper",
        {{"com.vorlane.private.Stowly.wipeContainer", STWValue(STWValue::Array{STWValue("com.example.plugin")})}});
    ASSERT_EQ(code(send(0, keys("com.example.plugin", true, false, 4))), STWErrorSuccess);
    ASSERT_EQ(code(send(0, keys("com.example.other", true, false, 4))), STWErrorSuccess);
    EXPECT_EQ(STWDaemonProcess::replyError(*wiper, 11, {{"Identifier", STWValue("com.example.plugin")}}),
              STWErrorSuccess);
    EXPECT_EQ(STWDaemonProcess::replyError(*wiper, 11, {{"Identifier", STWValue("com.example.other")}}),
              STWErrorNotEntitled);
    EXPECT_EQ(code(send(12, {{"Identifier", STWValue("com.example.bundle")}, {"ContainerClass", STWValue(1)}})),
              STWErrorInvalidClass);
}

TEST_F(STWDeletionReplaceTest, AReplacePutsTheNewContainerInPlace) {
    auto live = send(0, keys("com.example.r"));
    auto fresh = send(0, keys("com.example.r", true, true));
    ASSERT_EQ(code(fresh), STWErrorSuccess);
    write(path(live) / "note", "old");
    write(path(fresh) / "note", "new");
    EXPECT_EQ(code(send(2, replaceKeys("com.example.r", live, live))), STWErrorReplaceWithSelf);
    EXPECT_EQ(code(send(2, replaceKeys("com.example.r", live, fresh))), STWErrorSuccess);
    auto found = send(0, keys("com.example.r", false));
    EXPECT_EQ(path(found), layout.live() / path(fresh).filename());
    EXPECT_EQ(read(path(found) / "note"), "new");
    EXPECT_FALSE(fs::exists(path(live)));
    EXPECT_FALSE(fs::exists(path(fresh)));
    EXPECT_EQ(count(layout.journals()), 0u);

    // Without an old container a transient one is promoted, unless a live one exists.
    auto promoted = send(0, keys("com.example.p", true, true));
    EXPECT_EQ(code(send(2, replaceKeys("com.example.p", {}, promoted))), STWErrorSuccess);
    EXPECT_EQ(path(send(0, keys("com.example.p", false))), layout.live() / path(promoted).filename());
    auto second = send(0, keys("com.example.p", true, true));
    EXPECT_EQ(code(send(2, replaceKeys("com.example.p", {}, second))), STWErrorAlreadyExists);
}

// Journals a stop left behind: one whose old and new places are both empty gets its
// parked container back; one whose old place is taken is only discarded, as is one that
// is not a journal. All go to death row before the first request.
TEST(STWReplaceRecovery, TheNextStartFollowsTheJournal) {
    STWDaemonProcess daemon({{"DeveloperMode", STWValue(true)}}, {}, false);
    Layout layout{daemon.root()};
    fs::path area = daemon.root() / "area";
    for (const char* d : {"parked1/x", "parked2/x", "taken2"})
        fs::create_directories(area / d);
    fs::create_directories(layout.journals());
    auto journal = [&](const char* name, int n, bool oldTaken) {
        std::string i = std::to_string(n);
        STWValue::Dictionary d{{"STWReplaceOperationOldURL", STWValue((area / (oldTaken ? "taken" + i : "old" + i)).string())},
                               {"STWReplaceOperationNewURL", STWValue((area / ("new" + i)).string())},
                               {"STWReplaceOperationStagingURL", STWValue((area / ("parked" + i)).string())},
                               {"STWReplaceOperationDestURL", STWValue((area / ("dest" + i)).string())}};
        ASSERT_TRUE(STW_writeToURL(d, layout.journals() / name, STWWriteAtomic, nullptr));
    };
    journal("A.plist", 1, false);
    journal("B.plist", 2, true);
    write(layout.journals() / "C.plist", "not a property list");
    ASSERT_TRUE(daemon.start());
    // Requests are served once start-up, recovery included, is done.
    EXPECT_EQ(STWDaemonProcess::replyError(*daemon.connect(), 27), STWErrorNotEntitled);
    EXPECT_TRUE(fs::is_directory(area / "old1/x"));
    EXPECT_FALSE(fs::exists(area / "parked1"));
    EXPECT_TRUE(fs::is_directory(area / "parked2/x"));
    EXPECT_EQ(count(layout.journals()), 0u);
}

// A daemon killed at each step of a replace, of a deletion and of a death-row pass: the
// next start finds the identity's container exactly once, whole (old or new content), or,
// once a deletion was acknowledged, not at all.
TEST(STWLifecycleCrash, EveryCrashPointLeavesOneWholeContainerOrNone) {
    auto internal = STWValue::Dictionary{{"DeveloperMode", STWValue(true)}, {"InternalImage", STWValue(true)}};
    std::vector<std::string_view> points(STWCrashPoint::replace.begin(), STWCrashPoint::replace.end());
    points.push_back(STWCrashPoint::deleteAfterStaging);
    points.push_back(STWCrashPoint::deathRowAfterFirstItem);
    for (std::string_view point : points) {
        SCOPED_TRACE(std::string(point));
        STWDaemonProcess daemon(internal, {}, false);
        Layout layout{daemon.root()};
        // The first start's cleanups pass over death row themselves: they run unarmed.
        ASSERT_TRUE(daemon.start());
        ASSERT_TRUE(daemon.waitForCleanups(true));
        daemon.stop();
        ASSERT_TRUE(daemon.startWith("STOWLY_CRASH_AT", std::string(point)));
        auto client = daemon.connectAs("com.example.installer", allowed);
        ASSERT_NE(client, nullptr);
        auto live = STWDaemonProcess::send(*client, 0, keys("com.example.k"));
        auto fresh = STWDaemonProcess::send(*client, 0, keys("com.example.k", true, true));
        write(path(live) / "note", "old");
        write(path(fresh) / "note", "new");
        bool replacing = point.starts_with("replace.");
        bool deleting = point == STWCrashPoint::deleteAfterStaging;
        if (replacing) {
            STWDaemonProcess::send(*client, 2, replaceKeys("com.example.k", live, fresh));
        } else {
            STWDaemonProcess::send(*client, 10, keys("com.example.k"));
            if (!deleting) {
                STWDaemonProcess::send(*client, 10, keys("com.example.k", true, true));
                STWDaemonProcess::send(*client, 4, {});
            }
        }
        ASSERT_TRUE(daemon.killedItself());

        ASSERT_TRUE(daemon.start());
        client = daemon.connectAs("com.example.installer", allowed);
        auto found = STWDaemonProcess::send(*client, 0, keys("com.example.k", false));
        EXPECT_EQ(count(layout.journals()), 0u);
        if (replacing) {
            bool moved = point == STWCrashPoint::replaceAfterMove || point == STWCrashPoint::replaceBeforeCleanup;
            ASSERT_EQ(code(found), STWErrorSuccess);
            EXPECT_EQ(read(path(found) / "note"), moved ? "new" : "old");
            EXPECT_EQ(count(layout.live()), 1u);
        } else {
            EXPECT_EQ(code(found), STWErrorNotFound);
            EXPECT_EQ(count(layout.live()), 0u);
        }
        // Whatever the crash left in death row, a pass empties it.
        EXPECT_EQ(code(STWDaemonProcess::send(*client, 4, {})), STWErrorSuccess);
        EXPECT_EQ(count(layout.deathRow()), 0u);
    }
}

// Deletion through death row, wipes, replaces, and the replace journals a start finds.
#include "tests/e2e/STWE2ETestSupport.h"

#include <gtest/gtest.h>

using namespace STWE2E;

namespace {

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

class STWDeletionReplaceTest : public SharedDaemonTest {
protected:
    void SetUp() override {
        client = daemon->connectAs(
            "com.example.installer",
            {{"com.vorlane.private.Stowly.allowed", STWValue(true)},
             {"com.vorlane.private.Stowly.deleteContainerContent", STWValue(true)},
             {"com.vorlane.private.Stowly.userManagedAssets", STWValue(true)},
             {"com.vorlane.private.Stowly.wipeContainer", STWValue(STWValue::Array{STWValue("com.example.plugin")})}});
        ASSERT_NE(client, nullptr);
    }
    Layout layout{daemon->root()};
};

} // namespace

// A deleted container leaves by death row. Staged by UUID: counts that differ queue nothing, an
// unknown UUID does not stop the next, and a container the app moved away or replaced with a
// link leaves the cache while nothing but the container itself is touched.
TEST_F(STWDeletionReplaceTest, DeletionAndStagingMoveOnlyTheContainerToDeathRow) {
    auto made = send(0, keys("com.example.gone"));
    ASSERT_EQ(code(made), STWErrorSuccess);
    write(path(made) / "note", "x");
    EXPECT_EQ(code(send(10, {{"ContainerClass", STWValue(2)}})), STWErrorNoIdentifier) << "no fallback to the caller";
    EXPECT_EQ(code(send(10, keys("com.example.gone"))), STWErrorSuccess);
    EXPECT_FALSE(fs::exists(path(made)));
    EXPECT_EQ(read(layout.deathRow() / path(made).filename() / "note"), "x");
    EXPECT_EQ(code(send(0, keys("com.example.gone", 2, false))), STWErrorNotFound);
    EXPECT_EQ(code(send(10, keys("com.example.gone"))), STWErrorNotFound);
    EXPECT_EQ(code(send(4, {})), STWErrorSuccess) << "the reply waits for the pass";
    EXPECT_EQ(visible(layout.deathRow()), 0u);

    auto a = send(0, keys("com.example.a")), b = send(0, keys("com.example.b")), c = send(0, keys("com.example.c"));
    ASSERT_EQ(code(a), STWErrorSuccess);
    auto mismatched = stageKeys({uuid(a), uuid(b)}, "com.example.a", a);
    mismatched["PersonaUniqueStringsArray"] = STWValue(STWValue::Array{STWValue("")});
    EXPECT_EQ(code(send(3, mismatched)), STWErrorInvalidArgument);
    EXPECT_TRUE(fs::exists(path(a)));

    EXPECT_EQ(code(send(3, stageKeys({STWUUID::random(), uuid(a)}, "com.example.a", a))), STWErrorSuccess);
    EXPECT_FALSE(fs::exists(path(a)));
    EXPECT_EQ(code(send(0, keys("com.example.a", 2, false))), STWErrorNotFound);

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
    EXPECT_EQ(code(send(0, keys("com.example.b", 2, false))), STWErrorNotFound);
    EXPECT_EQ(code(send(0, keys("com.example.c", 2, false))), STWErrorNotFound);
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
    EXPECT_EQ(visible(layout.journals()), 0u);
    ASSERT_TRUE(daemon->stop() && daemon->start());
    connect();
    auto found = send(0, keys("com.example.wiped", 2, false));
    EXPECT_EQ(path(found), path(made));
    EXPECT_EQ(uuid(found), uuid(made));

    auto wiper = daemon->connectAs(
        "com.example.wiper",
        {{"com.vorlane.private.Stowly.wipeContainer", STWValue(STWValue::Array{STWValue("com.example.plugin")})}});
    ASSERT_EQ(code(send(0, keys("com.example.plugin", 4))), STWErrorSuccess);
    ASSERT_EQ(code(send(0, keys("com.example.other", 4))), STWErrorSuccess);
    EXPECT_EQ(STWDaemonProcess::replyError(*wiper, 11, {{"Identifier", STWValue("com.example.plugin")}}),
              STWErrorSuccess);
    EXPECT_EQ(STWDaemonProcess::replyError(*wiper, 11, {{"Identifier", STWValue("com.example.other")}}),
              STWErrorNotEntitled);
    EXPECT_EQ(code(send(12, {{"Identifier", STWValue("com.example.bundle")}, {"ContainerClass", STWValue(1)}})),
              STWErrorInvalidClass);
}

TEST_F(STWDeletionReplaceTest, AReplacePutsTheNewContainerInPlace) {
    auto live = send(0, keys("com.example.r"));
    auto fresh = send(0, keys("com.example.r", 2, true, true));
    ASSERT_EQ(code(fresh), STWErrorSuccess);
    write(path(live) / "note", "old");
    write(path(fresh) / "note", "new");
    EXPECT_EQ(code(send(2, replaceKeys("com.example.r", live, live))), STWErrorReplaceWithSelf);
    EXPECT_EQ(code(send(2, replaceKeys("com.example.r", live, fresh))), STWErrorSuccess);
    auto found = send(0, keys("com.example.r", 2, false));
    EXPECT_EQ(path(found), layout.live() / path(fresh).filename());
    EXPECT_EQ(read(path(found) / "note"), "new");
    EXPECT_FALSE(fs::exists(path(live)));
    EXPECT_FALSE(fs::exists(path(fresh)));
    EXPECT_EQ(visible(layout.journals()), 0u);

    // Without an old container a transient one is promoted, unless a live one exists.
    auto promoted = send(0, keys("com.example.p", 2, true, true));
    EXPECT_EQ(code(send(2, replaceKeys("com.example.p", {}, promoted))), STWErrorSuccess);
    EXPECT_EQ(path(send(0, keys("com.example.p", 2, false))), layout.live() / path(promoted).filename());
    auto second = send(0, keys("com.example.p", 2, true, true));
    EXPECT_EQ(code(send(2, replaceKeys("com.example.p", {}, second))), STWErrorAlreadyExists);
}

// Journals a stop left behind: one whose old and new places are empty gets its parked container
// back; one whose old place is taken, one that is no journal, and one whose places are all gone
// (a replace that failed only to remove it) are discarded. All go before the first request.
TEST(STWReplaceRecovery, TheNextStartFollowsTheJournal) {
    STWDaemonProcess daemon(developer, {}, false);
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
    journal("D.plist", 3, false);
    write(layout.journals() / "C.plist", "not a property list");
    ASSERT_TRUE(daemon.start());
    // Requests are served once start-up, recovery included, is done.
    EXPECT_EQ(STWDaemonProcess::replyError(*daemon.connect(), 27), STWErrorNotEntitled);
    EXPECT_TRUE(fs::is_directory(area / "old1/x"));
    EXPECT_FALSE(fs::exists(area / "parked1"));
    EXPECT_TRUE(fs::is_directory(area / "parked2/x"));
    EXPECT_EQ(visible(layout.journals()), 0u);
}

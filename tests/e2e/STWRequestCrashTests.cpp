// Requests cut short by a kill at a crash point or a failing call. That a kill leaves whole
// containers, one per identity, no leftovers and answers that match the disk is the crash
// torture's check (scripts/torture); here each point's request has the one outcome it must.
#include "tests/e2e/STWE2ETestSupport.h"

#include "common/STWFormat.h"
#include "platform/STWCrashPoint.h"

#include <gtest/gtest.h>

using namespace STWE2E;

// A creation counts once its container is published, a replace once the new container is
// moved in place, a deletion once the container is in death row.
TEST(STWRequestCrash, TheNextStartSettlesTheRequestOfEachPointOneWay) {
    STWDaemonProcess daemon(internal);
    Layout layout{daemon.root()};
    // The first start's cleanups pass over death row themselves: they run unarmed.
    ASSERT_TRUE(daemon.waitForCleanups(true));
    namespace P = STWCrashPoint;
    // What the identity's container holds afterwards: nullptr for none, "" for a new one.
    const std::pair<const char*, const char*> cases[] = {
        {P::createAfterStaging, nullptr}, {P::createAfterRename, ""},   {P::createBeforeCacheAdd, ""},
        {P::replaceAfterJournal, "old"},  {P::replaceAfterPark, "old"}, {P::replaceAfterMove, "new"},
        {P::replaceBeforeCleanup, "new"}, {P::deleteAfterStaging, nullptr}, {P::deathRowAfterFirstItem, nullptr}};
    unsigned n = 0;
    for (const auto& [point, note] : cases) {
        SCOPED_TRACE(point);
        std::string identifier = STWFormat("com.example.c%u", ++n), kind(point, std::string_view(point).find('.'));
        ASSERT_TRUE(daemon.stop());
        ASSERT_TRUE(daemon.startWith("STOWLY_CRASH_AT", point));
        auto client = daemon.connectAs("com.example.installer", allowed);
        ASSERT_NE(client, nullptr);
        auto send = [&](uint64_t command, STWValue::Dictionary k) {
            return STWDaemonProcess::send(*client, command, std::move(k));
        };
        if (kind == "create") {
            EXPECT_TRUE(send(0, keys(identifier)).empty()) << "no reply from a daemon that died";
        } else {
            auto live = send(0, keys(identifier)), fresh = send(0, keys(identifier, 2, true, true));
            write(path(live) / "note", "old");
            write(path(fresh) / "note", "new");
            if (kind == "replace")
                send(2, replaceKeys(identifier, live, fresh));
            else
                send(10, keys(identifier));
            if (kind == "deathrow") { // a pass over death row with two items in it
                send(10, keys(identifier, 2, true, true));
                send(4, {});
            }
        }
        ASSERT_TRUE(daemon.killedItself());

        ASSERT_TRUE(daemon.start());
        client = daemon.connectAs("com.example.installer", allowed);
        auto found = send(0, keys(identifier, 2, false));
        auto onDisk = containersOf(layout.live(), identifier);
        if (!note) {
            EXPECT_EQ(code(found), STWErrorNotFound);
            EXPECT_EQ(onDisk.size(), 0u);
        } else {
            ASSERT_EQ(code(found), STWErrorSuccess);
            ASSERT_EQ(onDisk.size(), 1u);
            EXPECT_EQ(path(found), onDisk[0]);
            EXPECT_TRUE(fs::is_directory(onDisk[0] / "Library/Caches")) << "published whole";
            EXPECT_EQ(*note ? read(onDisk[0] / "note") : "", note);
        }
        // Whatever the crash left in death row, a pass empties it (before the next armed start).
        EXPECT_EQ(code(send(4, {})), STWErrorSuccess);
    }
}

// Every call of each kind that a creation makes fails in turn (ENOSPC): the request fails
// and leaves no container, nothing in staging and, once death row is emptied, nothing
// there; the first run in which no call of the kind fails makes the container whole.
TEST(STWRequestCrash, AFailedCallAtAnyStepOfACreationLeavesNothingBehind) {
    STWDaemonProcess daemon(internal, {}, false);
    Layout layout{daemon.root()};
    for (const char* point : {"mkdirat", "create", "write", "fsync", "renameat2", "fchown", "setxattr", "setflags"}) {
        for (unsigned call = 1;; ++call) {
            SCOPED_TRACE(std::string(point) + ":" + std::to_string(call));
            ASSERT_LT(call, 40u) << "the creation never got past the point";
            std::string identifier = STWFormat("com.example.%s.%u", point, call);
            ASSERT_TRUE(daemon.startWith("STOWLY_FAULT", STWFormat("%s:%u:28", point, call)));
            auto client = daemon.connectAs("com.example.installer", allowed);
            ASSERT_NE(client, nullptr);
            size_t before = visible(layout.live());
            uint64_t error = STWDaemonProcess::replyError(*client, 0, keys(identifier));
            bool created = error == STWErrorSuccess;
            // A failed write is the metadata file's.
            EXPECT_TRUE(created || std::string_view(point) != "write" || error == STWErrorWriteFileFailed) << error;
            // Death row empties in the background; a daemon that stops finishes that first.
            ASSERT_TRUE(daemon.stop());
            auto found = containersOf(layout.live(), identifier);
            EXPECT_EQ(found.size(), created ? 1u : 0u);
            EXPECT_EQ(visible(layout.live()), before + (created ? 1 : 0));
            EXPECT_EQ(visible(layout.userStaging()), 0u);
            EXPECT_EQ(visible(layout.deathRow()), 0u);
            if (created) {
                EXPECT_TRUE(!found.empty() && fs::is_directory(found[0] / "Library/Caches"));
                break;
            }
        }
    }
}

// Creating, looking up and describing containers over the socket, and the test locks.
#include "tests/e2e/STWE2ETestSupport.h"

#include <acl/libacl.h>
#include <gtest/gtest.h>
#include <sys/acl.h>

#include <atomic>
#include <thread>
#include <unistd.h>

using namespace STWE2E;

using STWContainerCommandsTest = SharedDaemonTest;

// A lookup without create makes nothing; a container its app took away is reported once
// (metadata missing), then not found; class 0 and 14 are no classes. Plug-in data whose
// parent is unknown belongs, like any unknown bundle, to the personal persona. A transient
// container asked for again is a new one, and the old one goes.
TEST_F(STWContainerCommandsTest, CreateOrLookupAnswersWhatIsThere) {
    auto reply = send(0, keys("com.example.absent", 2, false));
    EXPECT_EQ(code(reply), STWErrorNotFound);
    EXPECT_FALSE(reply.count("ReplyPath"));
    fs::path fragile = path(send(0, keys("com.example.fragile")));
    ASSERT_FALSE(fragile.empty());
    fs::rename(fragile, fragile.string() + ".gone");
    EXPECT_EQ(code(send(0, keys("com.example.fragile", 2, false))), STWErrorMetadataMissing);
    EXPECT_EQ(code(send(0, keys("com.example.fragile", 2, false))), STWErrorNotFound);
    EXPECT_EQ(code(send(0, keys("com.example.absent", 0))), STWErrorUnexpectedClass);
    EXPECT_EQ(code(send(0, keys("com.example.absent", 14))), STWErrorUnexpectedClass);
    auto plugin = send(0, keys("com.example.plugin", 4));
    ASSERT_EQ(code(plugin), STWErrorSuccess);
    EXPECT_EQ(*STWDictionaryString(plugin, "ReplyPersonaUniqueString"), "PERSONAL-1");
    fs::path old = path(send(0, keys("com.example.scratch", 2, true, true)));
    ASSERT_FALSE(old.empty());
    write(old / "Documents/leftover", "data");
    fs::path second = path(send(0, keys("com.example.scratch", 2, true, true)));
    ASSERT_FALSE(second.empty());
    EXPECT_NE(second, old);
    EXPECT_FALSE(fs::exists(old));
    EXPECT_FALSE(fs::exists(second / "Documents/leftover"));
}

TEST_F(STWContainerCommandsTest, SystemContainersAreNamedAndGuarded) {
    auto reply = send(0, keys("com.vorlane.maple", 12));
    ASSERT_EQ(code(reply), STWErrorSuccess);
    EXPECT_EQ(path(reply).filename(), "com.vorlane.maple");
    // The group may create items in the container; what lies below is the group's in full.
    auto aclText = [](const fs::path& item) {
        acl_t acl = acl_get_file(item.c_str(), ACL_TYPE_ACCESS);
        char* text = acl ? acl_to_any_text(acl, nullptr, ',', TEXT_ABBREVIATE | TEXT_NUMERIC_IDS) : nullptr;
        std::string result = text ? text : "";
        acl_free(text);
        acl_free(acl);
        return result;
    };
    EXPECT_NE(aclText(path(reply)).find("g:950:-wx"), std::string::npos) << aclText(path(reply));
    int subdirectories = 0;
    for (const auto& item : fs::directory_iterator(path(reply))) {
        if (item.is_directory()) {
            ++subdirectories;
            EXPECT_EQ(aclText(item.path()), "u::---,g::---,g:950:rwx,m::rwx,o::---") << item.path();
        }
    }
    EXPECT_GT(subdirectories, 0);

    // A program asking for its own system container needs more than being itself.
    auto plain = daemon->connectAs("com.example.service", {});
    STWValue::Dictionary own{{"ContainerClass", STWValue(12)}, {"CreateIfNecessary", STWValue(true)}};
    EXPECT_EQ(STWDaemonProcess::replyError(*plain, 0, own), STWErrorNotEntitled);
    // And nobody unentitled reaches another identifier's container.
    EXPECT_EQ(STWDaemonProcess::replyError(*plain, 0, keys("com.example.other")), STWErrorNotEntitled);
}

TEST_F(STWContainerCommandsTest, MetadataAndStructureCommandsActOnTheConcreteContainer) {
    auto created = send(0, keys("com.example.meta"));
    ASSERT_EQ(code(created), STWErrorSuccess);
    fs::path container = path(created);
    STWValue::Dictionary concrete{{"Identifier", STWValue("com.example.meta")},
                                  {"ContainerClass", STWValue(2)},
                                  {"UUID", STWValue(uuid(created))},
                                  {"InfoDictRequested", STWValue(true)}};
    auto metadata = send(7, concrete);
    ASSERT_EQ(code(metadata), STWErrorSuccess);
    EXPECT_EQ(path(metadata), container);
    EXPECT_EQ(STWDictionaryFind(metadata, "ReplyTransient")->boolValue(), false);

    for (uint64_t command : {8u, 22u}) {
        fs::remove_all(container / "Library");
        EXPECT_EQ(code(send(command, concrete)), STWErrorSuccess);
        EXPECT_TRUE(fs::is_directory(container / "Library/Caches"));
    }
    concrete["UUID"] = STWValue(STWUUID::random());
    EXPECT_EQ(code(send(7, concrete)), STWErrorNotFound);
    // The all-zero UUID is a UUID like any other.
    concrete["UUID"] = STWValue(*STWUUID::fromString("00000000-0000-0000-0000-000000000000"));
    for (uint64_t command : {7u, 8u, 22u})
        EXPECT_EQ(code(send(command, concrete)), STWErrorNotFound) << command;
    concrete.erase("Identifier");
    EXPECT_EQ(code(send(8, concrete)), STWErrorNoIdentifier);
}

// What a restart rebuilds from the metadata files: a data container's mapping under its
// user, the kernel persona id (PERSONAL-1 is 1000) and its item type, once (a bundle has
// none); and the container of the empty identifier, which is an identifier like any other.
TEST_F(STWContainerCommandsTest, MappingsAndTheEmptyIdentifierSurviveARestart) {
    auto data = send(0, keys("com.example.mapped"));
    auto bundle = send(0, keys("com.example.mapped", 1));
    auto empty = send(0, keys(""));
    ASSERT_EQ(code(data), STWErrorSuccess);
    ASSERT_EQ(code(bundle), STWErrorSuccess);
    ASSERT_EQ(code(empty), STWErrorSuccess);
    size_t before = visible(path(empty).parent_path());
    EXPECT_EQ(path(send(0, keys(""))), path(empty));
    auto linksTo = [&](const fs::path& target) {
        std::vector<fs::path> found;
        std::error_code ec;
        for (fs::recursive_directory_iterator it(daemon->root() / "run/stowly/sandbox", ec), end;
             !ec && it != end; it.increment(ec))
            if (it->is_symlink() && fs::read_symlink(it->path()) == target)
                found.push_back(it->path());
        return found;
    };
    auto expected = std::vector<fs::path>{daemon->root() / "run/stowly/sandbox/501/1000/1/com.example.mapped"};
    EXPECT_EQ(linksTo(path(data)), expected);
    EXPECT_TRUE(linksTo(path(bundle)).empty());
    ASSERT_TRUE(daemon->stop());
    ASSERT_TRUE(daemon->start());
    connect();
    ASSERT_EQ(code(send(0, keys("com.example.mapped", 2, false))), STWErrorSuccess);
    EXPECT_EQ(linksTo(path(data)), expected);
    auto found = send(0, keys("", 2, false));
    EXPECT_EQ(code(found), STWErrorSuccess);
    EXPECT_EQ(path(found), path(empty));
    EXPECT_EQ(visible(path(empty).parent_path()), before);
}

// On internal builds a test client can hold the daemon-wide write lock; creation waits
// for it, and releasing the lock lets the waiting request through. SIGTERM releases the
// test locks too, so a daemon with a request parked behind one still exits cleanly.
TEST(STWTestLockCommand, DaemonWideWriteLockParksCreationUntilReleased) {
    STWDaemonProcess daemon(internal);
    auto control = daemon.connectAs("com.example.tester", tester);
    ASSERT_NE(control, nullptr);
    ASSERT_EQ(setTestLock(*control, 1, true), STWErrorSuccess);
    std::atomic<uint64_t> result{0};
    std::thread creator([&] {
        auto client = daemon.connectAs("com.example.installer", allowed);
        result = STWDaemonProcess::replyError(*client, 0, keys("com.example.parked"));
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    EXPECT_EQ(result.load(), 0u); // still waiting for the lock
    EXPECT_EQ(setTestLock(*control, 1, false), STWErrorSuccess);
    creator.join();
    EXPECT_EQ(result.load(), STWErrorSuccess);
    EXPECT_EQ(setTestLock(*control, 7, true), STWErrorInvalidArgument);

    ASSERT_EQ(setTestLock(*control, 1, true), STWErrorSuccess);
    std::thread parked([&] {
        if (auto client = daemon.connectAs("com.example.installer", allowed))
            STWDaemonProcess::replyError(*client, 0, keys("com.example.parked.again"));
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    EXPECT_TRUE(daemon.stop());
    parked.join();
}

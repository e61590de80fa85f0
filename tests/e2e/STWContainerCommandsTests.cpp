#include "tests/support/STWDaemonProcess.h"
#include "tests/support/STWTestRoot.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWError.h"
#include "common/STWFileIO.h"
#include "platform/STWAuditToken.h"
#include "platform/STWSandboxExtension.h"

#include <acl/libacl.h>
#include <gtest/gtest.h>
#include <sys/acl.h>

#include <atomic>
#include <fstream>
#include <set>
#include <thread>
#include <unistd.h>

namespace {

const STWValue::Dictionary allowed{{"com.vorlane.private.Stowly.allowed", STWValue(true)}};

STWValue::Dictionary createKeys(const std::string& identifier, uint64_t containerClass, bool create = true,
                                bool transient = false) {
    return {{"Identifier", STWValue(identifier)},
            {"ContainerClass", STWValue(containerClass)},
            {"CreateIfNecessary", STWValue(create)},
            {"Transient", STWValue(transient)}};
}

std::string path(const STWValue::Dictionary& reply) {
    const std::string* p = STWDictionaryString(reply, "ReplyPath");
    return p ? *p : std::string();
}

uint64_t code(const STWValue::Dictionary& reply) { return STWDictionaryUInt64(reply, "ReplyError").value_or(0); }

// Entries of a directory, without dot names.
std::vector<std::string> entries(const std::filesystem::path& directory) {
    std::vector<std::string> names;
    std::error_code ec;
    for (std::filesystem::directory_iterator it(directory, ec), end; !ec && it != end; it.increment(ec))
        if (it->path().filename().native()[0] != '.')
            names.push_back(it->path().filename());
    return names;
}

class STWContainerCommandsTest : public ::testing::Test {
protected:
    static void SetUpTestSuite() {
        daemon = new STWDaemonProcess({{"DeveloperMode", STWValue(true)}},
                                      {STWTestRoot::persona("PERSONAL-1", 1000, "personal"),
                                       STWTestRoot::persona("ENTERPRISE-1", 1001, "enterprise",
                                                            {STWValue("com.example.work")})});
    }
    static void TearDownTestSuite() {
        delete daemon;
        daemon = nullptr;
    }
    static STWDaemonProcess* daemon;
};
STWDaemonProcess* STWContainerCommandsTest::daemon = nullptr;

} // namespace

TEST_F(STWContainerCommandsTest, LookupWithoutCreateFindsNothingAndMakesNothing) {
    auto client = daemon->connectAs("com.example.installer", allowed);
    ASSERT_NE(client, nullptr);
    auto reply = STWDaemonProcess::send(*client, 0, createKeys("com.example.absent", 2, false));
    EXPECT_EQ(code(reply), STWErrorNotFound);
    EXPECT_FALSE(reply.count("ReplyPath"));
    // Class 0 and 14 are not classes.
    EXPECT_EQ(STWDaemonProcess::replyError(*client, 0, createKeys("com.example.absent", 0)), STWErrorUnexpectedClass);
    EXPECT_EQ(STWDaemonProcess::replyError(*client, 0, createKeys("com.example.absent", 14)), STWErrorUnexpectedClass);
    // Plug-in data whose parent is unknown belongs, like any unknown bundle, to the
    // personal persona.
    auto plugin = STWDaemonProcess::send(*client, 0, createKeys("com.example.plugin", 4));
    ASSERT_EQ(code(plugin), STWErrorSuccess);
    EXPECT_EQ(*STWDictionaryString(plugin, "ReplyPersonaUniqueString"), "PERSONAL-1");
}

TEST_F(STWContainerCommandsTest, ConcurrentCreatesMakeExactlyOneContainer) {
    constexpr int kClients = 32;
    // Learn where class 2 lives, and what is there before the race.
    auto probe = STWDaemonProcess::send(*daemon->connectAs("com.example.installer", allowed), 0,
                                        createKeys("com.example.probe", 2));
    ASSERT_EQ(code(probe), STWErrorSuccess);
    std::filesystem::path classDirectory = std::filesystem::path(path(probe)).parent_path();
    size_t before = entries(classDirectory).size();
    std::vector<STWValue::Dictionary> replies(kClients);
    std::vector<std::thread> threads;
    for (int i = 0; i < kClients; i++) {
        threads.emplace_back([&, i] {
            auto client = daemon->connectAs("com.example.installer", allowed);
            if (client)
                replies[i] = STWDaemonProcess::send(*client, 0, createKeys("com.example.racer", 2));
        });
    }
    for (auto& t : threads)
        t.join();
    int created = 0, existed = 0;
    std::set<std::string> paths;
    for (const auto& reply : replies) {
        ASSERT_EQ(code(reply), STWErrorSuccess);
        paths.insert(path(reply));
        const STWValue* flag = STWDictionaryFind(reply, "ReplyExisted");
        ASSERT_NE(flag, nullptr);
        (flag->boolValue().value_or(false) ? existed : created)++;
    }
    EXPECT_EQ(created, 1);
    EXPECT_EQ(existed, kClients - 1);
    ASSERT_EQ(paths.size(), 1u);
    std::filesystem::path container = *paths.begin();
    EXPECT_TRUE(std::filesystem::is_directory(container / "Library/Preferences"));
    EXPECT_TRUE(std::filesystem::exists(container / ".com.vorlane.stowly.metadata.plist"));
    EXPECT_EQ(container.parent_path(), classDirectory);
    EXPECT_EQ(entries(classDirectory).size(), before + 1);
    auto reply = STWDaemonProcess::send(*daemon->connectAs("com.example.installer", allowed), 1,
                                        {{"ContainerClass", STWValue(2)}});
    ASSERT_EQ(code(reply), STWErrorSuccess);
    int listed = 0;
    for (const auto& id : *STWDictionaryFind(reply, "ReplyIdsArray")->array())
        listed += *id.string() == "com.example.racer";
    EXPECT_EQ(listed, 1);
}

TEST_F(STWContainerCommandsTest, TransientRecreateRetiresTheOldContainer) {
    auto client = daemon->connectAs("com.example.installer", allowed);
    auto first = STWDaemonProcess::send(*client, 0, createKeys("com.example.scratch", 2, true, true));
    ASSERT_EQ(code(first), STWErrorSuccess);
    std::filesystem::path old = path(first);
    std::ofstream(old / "Documents" / "leftover") << "data";
    auto second = STWDaemonProcess::send(*client, 0, createKeys("com.example.scratch", 2, true, true));
    ASSERT_EQ(code(second), STWErrorSuccess);
    EXPECT_NE(path(second), old.native());
    EXPECT_FALSE(std::filesystem::exists(old));
    EXPECT_FALSE(std::filesystem::exists(std::filesystem::path(path(second)) / "Documents" / "leftover"));
}

TEST_F(STWContainerCommandsTest, SystemContainersAreNamedAndGuarded) {
    auto installer = daemon->connectAs("com.example.installer", allowed);
    auto reply = STWDaemonProcess::send(*installer, 0, createKeys("com.vorlane.maple", 12));
    ASSERT_EQ(code(reply), STWErrorSuccess);
    EXPECT_EQ(std::filesystem::path(path(reply)).filename(), "com.vorlane.maple");
    // The group may create items in the container; what lies below is the group's in full.
    auto aclText = [](const std::filesystem::path& item) {
        acl_t acl = acl_get_file(item.c_str(), ACL_TYPE_ACCESS);
        char* text = acl ? acl_to_any_text(acl, nullptr, ',', TEXT_ABBREVIATE | TEXT_NUMERIC_IDS) : nullptr;
        std::string result = text ? text : "";
        acl_free(text);
        acl_free(acl);
        return result;
    };
    EXPECT_NE(aclText(path(reply)).find("g:950:-wx"), std::string::npos) << aclText(path(reply));
    int subdirectories = 0;
    for (const auto& item : std::filesystem::directory_iterator(path(reply))) {
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
    EXPECT_EQ(STWDaemonProcess::replyError(*plain, 0, createKeys("com.example.other", 2)), STWErrorNotEntitled);
}

TEST_F(STWContainerCommandsTest, MetadataAndStructureCommandsActOnTheConcreteContainer) {
    auto client = daemon->connectAs("com.example.installer", allowed);
    auto created = STWDaemonProcess::send(*client, 0, createKeys("com.example.meta", 2));
    ASSERT_EQ(code(created), STWErrorSuccess);
    const STWValue* uuid = STWDictionaryFind(created, "ReplyUUID");
    ASSERT_TRUE(uuid && uuid->uuid());
    STWValue::Dictionary concrete{{"Identifier", STWValue("com.example.meta")},
                                  {"ContainerClass", STWValue(2)},
                                  {"UUID", *uuid},
                                  {"InfoDictRequested", STWValue(true)}};
    auto metadata = STWDaemonProcess::send(*client, 7, concrete);
    ASSERT_EQ(code(metadata), STWErrorSuccess);
    EXPECT_EQ(path(metadata), path(created));
    EXPECT_EQ(STWDictionaryFind(metadata, "ReplyTransient")->boolValue(), false);

    std::filesystem::remove_all(std::filesystem::path(path(created)) / "Library");
    for (uint64_t command : {8u, 22u}) {
        EXPECT_EQ(STWDaemonProcess::replyError(*client, command, concrete), STWErrorSuccess);
        EXPECT_TRUE(std::filesystem::is_directory(std::filesystem::path(path(created)) / "Library/Caches"));
        std::filesystem::remove_all(std::filesystem::path(path(created)) / "Library");
    }
    concrete["UUID"] = STWValue(STWUUID::random());
    EXPECT_EQ(STWDaemonProcess::replyError(*client, 7, concrete), STWErrorNotFound);
    // The all-zero UUID is a UUID like any other.
    concrete["UUID"] = STWValue(*STWUUID::fromString("00000000-0000-0000-0000-000000000000"));
    for (uint64_t command : {7u, 8u, 22u})
        EXPECT_EQ(STWDaemonProcess::replyError(*client, command, concrete), STWErrorNotFound) << command;
    concrete.erase("Identifier");
    EXPECT_EQ(STWDaemonProcess::replyError(*client, 8, concrete), STWErrorNoIdentifier);
}

TEST_F(STWContainerCommandsTest, VanishedMetadataIsReportedOnceThenNotFound) {
    auto client = daemon->connectAs("com.example.installer", allowed);
    auto created = STWDaemonProcess::send(*client, 0, createKeys("com.example.fragile", 2));
    ASSERT_EQ(code(created), STWErrorSuccess);
    // Its app takes the container away.
    std::filesystem::rename(path(created), path(created) + ".gone");
    EXPECT_EQ(STWDaemonProcess::replyError(*client, 0, createKeys("com.example.fragile", 2, false)),
              STWErrorMetadataMissing);
    EXPECT_EQ(STWDaemonProcess::replyError(*client, 0, createKeys("com.example.fragile", 2, false)), STWErrorNotFound);
}

TEST_F(STWContainerCommandsTest, SandboxedEnterpriseCallerGetsAVerifiableToken) {
    auto work = daemon->connectAs("com.example.work", {}, true, "ENTERPRISE-1");
    ASSERT_NE(work, nullptr);
    STWValue::Dictionary own{{"ContainerClass", STWValue(2)}, {"CreateIfNecessary", STWValue(true)}};
    auto reply = STWDaemonProcess::send(*work, 0, own);
    ASSERT_EQ(code(reply), STWErrorSuccess);
    EXPECT_EQ(STWDictionaryString(reply, "ReplyPersonaUniqueString") ? *STWDictionaryString(reply, "ReplyPersonaUniqueString") : "",
              "ENTERPRISE-1");
    const std::string* token = STWDictionaryString(reply, "SandboxToken");
    ASSERT_NE(token, nullptr);
    std::string key;
    ASSERT_EQ(STWReadFileContents(daemon->root() / "run/stowly/extension.key", &key), 0);
    auto auditToken = STWAuditToken::forProcess(getpid(), geteuid(), getegid());
    ASSERT_TRUE(auditToken.has_value());
    EXPECT_TRUE(STWSandboxExtension::verify(*token, STWSandboxExtension::containerClass, path(reply), *auditToken, key));
    EXPECT_FALSE(STWSandboxExtension::verify(*token, STWSandboxExtension::containerClass, path(reply) + "x",
                                             *auditToken, key));

    // A personal caller, sandboxed or not, gets no token.
    auto personal = daemon->connectAs("com.example.home", {}, true);
    auto plain = STWDaemonProcess::send(*personal, 0, own);
    ASSERT_EQ(code(plain), STWErrorSuccess);
    EXPECT_FALSE(plain.count("SandboxToken"));
}

// A data container's mapping sits under its user, the kernel persona id (PERSONAL-1 is
// 1000) and its item type, once, also after a restart; a bundle has none.
TEST_F(STWContainerCommandsTest, DataContainersAreMappedForTheSandboxAndBundlesAreNot) {
    auto client = daemon->connectAs("com.example.installer", allowed);
    auto data = STWDaemonProcess::send(*client, 0, createKeys("com.example.mapped", 2));
    auto bundle = STWDaemonProcess::send(*client, 0, createKeys("com.example.mapped", 1));
    ASSERT_EQ(code(data), STWErrorSuccess);
    ASSERT_EQ(code(bundle), STWErrorSuccess);
    auto linksTo = [&](const std::string& target) {
        std::vector<std::filesystem::path> found;
        std::error_code ec;
        for (std::filesystem::recursive_directory_iterator it(daemon->root() / "run/stowly/sandbox", ec), end;
             !ec && it != end; it.increment(ec))
            if (it->is_symlink() && std::filesystem::read_symlink(it->path()) == target)
                found.push_back(it->path());
        return found;
    };
    auto expected = std::vector<std::filesystem::path>{daemon->root() / "run/stowly/sandbox/501/1000/1/com.example.mapped"};
    EXPECT_EQ(linksTo(path(data)), expected);
    EXPECT_TRUE(linksTo(path(bundle)).empty());
    ASSERT_TRUE(daemon->stop());
    ASSERT_TRUE(daemon->start());
    client = daemon->connectAs("com.example.installer", allowed);
    ASSERT_EQ(code(STWDaemonProcess::send(*client, 0, createKeys("com.example.mapped", 2, false))), STWErrorSuccess);
    EXPECT_EQ(linksTo(path(data)), expected);
}

// On internal builds a test client can hold the daemon-wide write lock; creation waits
// for it, and releasing the lock lets the waiting request through. SIGTERM releases the
// test locks too, so a daemon with a request parked behind one still exits cleanly.
TEST(STWTestLockCommand, DaemonWideWriteLockParksCreationUntilReleased) {
    STWDaemonProcess daemon({{"DeveloperMode", STWValue(true)}, {"InternalImage", STWValue(true)}});
    STWValue::Dictionary tester{{"com.vorlane.private.Stowly.testability", STWValue(true)}};
    auto control = daemon.connectAs("com.example.tester", tester);
    ASSERT_NE(control, nullptr);
    ASSERT_EQ(STWDaemonProcess::replyError(*control, 31, {{"TestLock", STWValue(1)}, {"Enable", STWValue(true)}}),
              STWErrorSuccess);
    std::atomic<uint64_t> result{0};
    std::thread creator([&] {
        auto client = daemon.connectAs("com.example.installer", allowed);
        result = STWDaemonProcess::replyError(*client, 0, createKeys("com.example.parked", 2));
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    EXPECT_EQ(result.load(), 0u); // still waiting for the lock
    EXPECT_EQ(STWDaemonProcess::replyError(*control, 31, {{"TestLock", STWValue(1)}, {"Enable", STWValue(false)}}),
              STWErrorSuccess);
    creator.join();
    EXPECT_EQ(result.load(), STWErrorSuccess);
    EXPECT_EQ(STWDaemonProcess::replyError(*control, 31, {{"TestLock", STWValue(7)}, {"Enable", STWValue(true)}}),
              STWErrorInvalidArgument);

    ASSERT_EQ(STWDaemonProcess::replyError(*control, 31, {{"TestLock", STWValue(1)}, {"Enable", STWValue(true)}}),
              STWErrorSuccess);
    std::thread parked([&] {
        if (auto client = daemon.connectAs("com.example.installer", allowed))
            STWDaemonProcess::replyError(*client, 0, createKeys("com.example.parked.again", 2));
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    EXPECT_TRUE(daemon.stop());
    parked.join();
}

// The empty string is an identifier like any other, before and after a restart, and
// making it leaves exactly one directory.
TEST_F(STWContainerCommandsTest, TheEmptyIdentifierIsAnIdentifier) {
    auto client = daemon->connectAs("com.example.installer", allowed);
    auto created = STWDaemonProcess::send(*client, 0, createKeys("", 2));
    ASSERT_EQ(code(created), STWErrorSuccess);
    std::filesystem::path classDirectory = std::filesystem::path(path(created)).parent_path();
    size_t before = entries(classDirectory).size();
    EXPECT_EQ(path(STWDaemonProcess::send(*client, 0, createKeys("", 2))), path(created));
    ASSERT_TRUE(daemon->stop());
    ASSERT_TRUE(daemon->start());
    client = daemon->connectAs("com.example.installer", allowed);
    auto found = STWDaemonProcess::send(*client, 0, createKeys("", 2, false));
    EXPECT_EQ(code(found), STWErrorSuccess);
    EXPECT_EQ(path(found), path(created));
    EXPECT_EQ(entries(classDirectory).size(), before);
}

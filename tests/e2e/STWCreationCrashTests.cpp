// A creation stopped half-way: by a daemon killed at each crash point, or by a failing
// system call at each step. What is found afterwards is the whole container or nothing.
#include "tests/support/STWDaemonProcess.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWError.h"
#include "common/STWFormat.h"
#include "platform/STWCrashPoint.h"

#include <gtest/gtest.h>


namespace fs = std::filesystem;

namespace {

const STWValue::Dictionary allowed{{"com.vorlane.private.Stowly.allowed", STWValue(true)}};

STWValue::Dictionary keys(bool create, const std::string& identifier = "com.example.crash") {
    return {{"Identifier", STWValue(identifier)},
            {"ContainerClass", STWValue(2)},
            {"CreateIfNecessary", STWValue(create)}};
}

// The containers of the class directory whose metadata names the identifier.
std::vector<fs::path> containersOf(const fs::path& classDirectory, const std::string& identifier) {
    std::vector<fs::path> found;
    std::error_code ec;
    for (fs::directory_iterator it(classDirectory, ec), end; !ec && it != end; it.increment(ec)) {
        auto metadata = STW_dictionaryWithContentsOfURL(it->path() / ".com.vorlane.stowly.metadata.plist", 0, nullptr);
        const std::string* name = metadata ? STWDictionaryString(*metadata, "STWMetadataIdentifier") : nullptr;
        if (name && *name == identifier)
            found.push_back(it->path());
    }
    return found;
}

} // namespace

TEST(STWCreationCrash, EveryCrashPointLeavesTheContainerWholeOrAbsent) {
    for (std::string_view point : STWCrashPoint::creation) {
        SCOPED_TRACE(std::string(point));
        STWDaemonProcess daemon({{"DeveloperMode", STWValue(true)}, {"InternalImage", STWValue(true)}}, {}, false);
        ASSERT_TRUE(daemon.startWith("STOWLY_CRASH_AT", std::string(point)));
        auto client = daemon.connectAs("com.example.installer", allowed);
        ASSERT_NE(client, nullptr);
        EXPECT_TRUE(STWDaemonProcess::send(*client, 0, keys(true)).empty()) << "no reply from a daemon that died";
        ASSERT_TRUE(daemon.killedItself());

        ASSERT_TRUE(daemon.start());
        client = daemon.connectAs("com.example.installer", allowed);
        auto reply = STWDaemonProcess::send(*client, 0, keys(false));
        fs::path classDirectory = daemon.root() / "private/var/mobile/Containers/Data/Application";
        auto found = containersOf(classDirectory, "com.example.crash");
        bool published = point != STWCrashPoint::createAfterStaging;
        ASSERT_EQ(found.size(), published ? 1u : 0u);
        if (published) {
            EXPECT_EQ(STWDictionaryUInt64(reply, "ReplyError"), STWErrorSuccess);
            EXPECT_EQ(*STWDictionaryString(reply, "ReplyPath"), found[0].string());
            EXPECT_TRUE(fs::is_directory(found[0] / "Library/Caches")) << "published whole";
        } else {
            EXPECT_EQ(STWDictionaryUInt64(reply, "ReplyError"), STWErrorNotFound);
        }
        // Whatever the crash left, creating goes on from there.
        EXPECT_EQ(STWDictionaryUInt64(STWDaemonProcess::send(*client, 0, keys(true)), "ReplyError"), STWErrorSuccess);
        EXPECT_EQ(containersOf(classDirectory, "com.example.crash").size(), 1u);
    }
}

// Every call of each kind that a creation makes fails in turn (ENOSPC): the request fails
// and leaves no container, nothing in staging and, once death row is emptied, nothing
// there; the first run in which no call of the kind fails makes the container whole.
TEST(STWCreationCrash, AFailedCallAtAnyStepLeavesNothingBehind) {
    STWDaemonProcess daemon({{"DeveloperMode", STWValue(true)}, {"InternalImage", STWValue(true)}}, {}, false);
    fs::path containers = daemon.root() / "private/var/mobile/Containers";
    fs::path deathRow = daemon.root() / "private/var/root/Library/Caches/com.vorlane.stowlyd/Dead";
    auto visible = [](const fs::path& directory) {
        size_t count = 0;
        std::error_code ec;
        for (fs::directory_iterator it(directory, ec), end; !ec && it != end; it.increment(ec))
            count += it->path().filename().native()[0] != '.';
        return count;
    };
    for (const char* point : {"mkdirat", "create", "write", "fsync", "renameat2", "fchown", "setxattr", "setflags"}) {
        for (unsigned call = 1;; ++call) {
            SCOPED_TRACE(std::string(point) + ":" + std::to_string(call));
            ASSERT_LT(call, 40u) << "the creation never got past the point";
            std::string identifier = STWFormat("com.example.%s.%u", point, call);
            ASSERT_TRUE(daemon.startWith("STOWLY_FAULT", STWFormat("%s:%u:28", point, call)));
            auto client = daemon.connectAs("com.example.installer", allowed);
            ASSERT_NE(client, nullptr);
            size_t before = visible(containers / "Data/Application");
            auto reply = STWDaemonProcess::send(*client, 0, keys(true, identifier));
            bool created = STWDictionaryUInt64(reply, "ReplyError") == STWErrorSuccess;
            if (!created && std::string_view(point) == "write") { // the metadata file's
                EXPECT_EQ(STWDictionaryUInt64(reply, "ReplyError"), STWErrorWriteFileFailed);
            }
            // Death row empties in the background; a daemon that stops finishes that first.
            ASSERT_TRUE(daemon.stop());
            EXPECT_EQ(containersOf(containers / "Data/Application", identifier).size(), created ? 1u : 0u);
            EXPECT_EQ(visible(containers / "Data/Application"), before + (created ? 1 : 0));
            EXPECT_EQ(visible(containers / "Staging"), 0u);
            EXPECT_EQ(visible(deathRow), 0u);
            if (created) {
                EXPECT_TRUE(fs::is_directory(containersOf(containers / "Data/Application", identifier)[0] /
                                             "Library/Caches"));
                break;
            }
        }
    }
}

// A daemon killed at each crash point of a creation: the next start finds the container
// exactly once (once the rename published it) or not at all, and never half-made.
#include "tests/support/STWDaemonProcess.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWError.h"
#include "platform/STWCrashPoint.h"

#include <gtest/gtest.h>

#include <csignal>
#include <cstdlib>
#include <sys/wait.h>

namespace fs = std::filesystem;

namespace {

const STWValue::Dictionary allowed{{"com.vorlane.private.Stowly.allowed", STWValue(true)}};

STWValue::Dictionary keys(bool create) {
    return {{"Identifier", STWValue("com.example.crash")},
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
        setenv("STOWLY_CRASH_AT", std::string(point).c_str(), 1);
        bool started = daemon.start();
        unsetenv("STOWLY_CRASH_AT");
        ASSERT_TRUE(started);
        auto client = daemon.connectAs("com.example.installer", allowed);
        ASSERT_NE(client, nullptr);
        EXPECT_TRUE(STWDaemonProcess::send(*client, 0, keys(true)).empty()) << "no reply from a daemon that died";
        auto status = daemon.waitForExit(STWDaemonProcess::timeout);
        ASSERT_TRUE(status && WIFSIGNALED(*status) && WTERMSIG(*status) == SIGKILL);

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

#include "Daemon/Lifecycle/STWApplicationTerminationAssertion.h"
#include "common/STWDictionaryUtilities.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <csignal>
#include <fstream>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

namespace fs = std::filesystem;

namespace {

// The applications are copies of sleep(1); the original is "another program".
const fs::path kSleep = "/usr/bin/sleep";
const std::string kHostileIdentifier = "../../../escape/app";

class STWApplicationTerminationAssertionTest : public ::testing::Test {
protected:
    void SetUp() override {
        records = STWTestRoot::shared().resolve("/run/stowly/terminated");
        app = registerCopy("com.example.app", "app");
        hostile = registerCopy(kHostileIdentifier, "hostile");
        STWClientRegistry::sharedInstance().reload();
    }
    void TearDown() override {
        for (pid_t pid : children) {
            kill(pid, SIGKILL);
            waitpid(pid, nullptr, 0);
        }
    }

    fs::path registerCopy(const std::string& identifier, const std::string& name) {
        fs::path executable = STWTestRoot::shared().resolve("/Applications") / name;
        fs::create_directories(executable.parent_path());
        fs::copy_file(kSleep, executable, fs::copy_options::overwrite_existing);
        STWValue::Dictionary entry{{"CodeSigningIdentifier", STWValue(identifier)},
                                   {"Executable", STWValue(executable.native())}};
        fs::path file = STWTestRoot::shared().resolve("/etc/stowly/clients.d") / (name + ".plist");
        fs::create_directories(file.parent_path());
        EXPECT_TRUE(STW_writeToURL(entry, file, STWWriteAtomic, nullptr));
        return executable;
    }
    pid_t spawn(const fs::path& executable) {
        char arg0[] = "sleep", arg1[] = "60";
        char* argv[] = {arg0, arg1, nullptr};
        pid_t pid = -1;
        EXPECT_EQ(posix_spawn(&pid, executable.c_str(), nullptr, nullptr, argv, environ), 0);
        children.push_back(pid);
        return pid;
    }
    // The signal that ended `pid`, or 0 while it still runs after `polls` times 10 ms.
    int exitSignal(pid_t pid, int polls) {
        for (int i = 0; i < polls; ++i) {
            int status = 0;
            if (waitpid(pid, &status, WNOHANG) == pid) {
                children.erase(std::find(children.begin(), children.end(), pid));
                return WIFSIGNALED(status) ? WTERMSIG(status) : -1;
            }
            usleep(10000);
        }
        return 0;
    }

    fs::path records, app, hostile;
    std::vector<pid_t> children;
};

} // namespace

TEST_F(STWApplicationTerminationAssertionTest, KillsTheApplicationAndKeepsTheRecordWhileAnyAssertionHoldsIt) {
    pid_t running = spawn(app);
    pid_t other = spawn(kSleep);
    auto first = STWApplicationTerminationAssertion::initWithBundleIdentifier("com.example.app", 0);
    ASSERT_NE(first, nullptr);
    ASSERT_NE(first->termAssertion(), nullptr);
    EXPECT_EQ(exitSignal(running, 1000), SIGKILL);
    EXPECT_EQ(exitSignal(other, 20), 0) << "the same program from another file is not the application";
    EXPECT_TRUE(fs::is_regular_file(records / "com.example.app"));

    auto second = STWApplicationTerminationAssertion::initWithBundleIdentifier("com.example.app", -1);
    ASSERT_NE(second, nullptr);
    first->invalidate();
    first.reset(); // invalidates again, which must not end the second's hold
    EXPECT_TRUE(fs::exists(records / "com.example.app"));
    second.reset();
    EXPECT_FALSE(fs::exists(records / "com.example.app"));
}

TEST_F(STWApplicationTerminationAssertionTest, UnknownHostileAndUnavailableIdentifiersHoldNothingOutside) {
    EXPECT_DEATH(STWApplicationTerminationAssertion::initWithBundleIdentifier("com.example.app", 2),
                 "Unknown reason: 2");
    EXPECT_EQ(STWApplicationTerminationAssertion::initWithBundleIdentifier("com.example.unknown", 0),
              nullptr);
    EXPECT_TRUE(fs::is_empty(records));

    // The record of an identifier that reads as a path stays in the directory.
    pid_t running = spawn(hostile);
    auto assertion = STWApplicationTerminationAssertion::initWithBundleIdentifier(kHostileIdentifier, 0);
    ASSERT_NE(assertion, nullptr);
    EXPECT_EQ(exitSignal(running, 1000), SIGKILL);
    EXPECT_EQ(std::distance(fs::directory_iterator(records), fs::directory_iterator()), 1);
    EXPECT_FALSE(fs::exists(STWTestRoot::shared().resolve("/escape")));
    assertion.reset();
    EXPECT_TRUE(fs::is_empty(records));

    // With no place for records the service is unavailable: nothing is held or killed.
    fs::remove(records);
    std::ofstream(records).put('x');
    running = spawn(app);
    auto unavailable = STWApplicationTerminationAssertion::initWithBundleIdentifier("com.example.app", 0);
    ASSERT_NE(unavailable, nullptr);
    EXPECT_EQ(unavailable->termAssertion(), nullptr);
    EXPECT_EQ(exitSignal(running, 20), 0);
    fs::remove(records);
}

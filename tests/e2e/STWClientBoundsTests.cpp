// What a hostile client can hold in the daemon: connections, unfinished frames, decoded
// values, time. A new client is still answered and memory stays bounded throughout.
#include "tests/e2e/STWE2ETestSupport.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWIPCFrame.h"

#include <gtest/gtest.h>

#include <atomic>
#include <fstream>
#include <functional>
#include <grp.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

using namespace std::chrono_literals;
using namespace STWE2E;

namespace {

constexpr size_t kMiB = 1024 * 1024;

size_t residentMiB(pid_t pid) {
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    std::string key;
    size_t kiB = 0;
    while (status >> key)
        if (key == "VmRSS:" && status >> kiB)
            break;
    return kiB / 1024;
}

// A new client gets its hello and a request answered (refused) within a second.
bool freshClientAnswered(STWDaemonProcess& daemon) {
    auto deadline = std::chrono::steady_clock::now() + 1s;
    auto left = [&] {
        return std::max(0ms, std::chrono::duration_cast<std::chrono::milliseconds>(
                                 deadline - std::chrono::steady_clock::now()));
    };
    STWErrorRef error;
    auto client = STWClient::connect(daemon.socketPath(), &error);
    if (!client || client->hello({{"CodeSigningIdentifier", STWValue("com.example.fresh")}}, left(),
                                 &error) != STWErrorSuccess)
        return false;
    auto reply = client->sendMessage({{"Command", STWValue(27)}}, left(), &error);
    return reply && STWDictionaryUInt64(*reply, "ReplyError");
}

// `attack` meets fresh clients that are answered, and memory below 300 MiB, then `baseline` + 50.
void survive(STWDaemonProcess& daemon, size_t baseline, const char* name, const std::function<void()>& attack,
             const std::function<void()>& stop) {
    size_t start = residentMiB(daemon.pid()), peak = start;
    std::atomic<bool> attacking{true};
    std::thread attacker([&] {
        attack();
        attacking = false;
    });
    int probes = 0;
    for (auto end = std::chrono::steady_clock::now() + 2s;
         attacking || std::chrono::steady_clock::now() < end;) {
        EXPECT_TRUE(freshClientAnswered(daemon)) << name << ": probe " << probes;
        probes++;
        peak = std::max(peak, residentMiB(daemon.pid()));
        std::this_thread::sleep_for(50ms);
    }
    attacker.join();
    stop();
    size_t after = residentMiB(daemon.pid());
    for (int i = 0; i < 100 && after > baseline + 50; i++) {
        std::this_thread::sleep_for(100ms);
        after = residentMiB(daemon.pid());
    }
    EXPECT_LT(peak, 300u) << name << ": " << start << " MiB before, " << probes << " probes";
    EXPECT_LE(after, baseline + 50) << name;
    EXPECT_TRUE(daemon.isRunning()) << name;
}

} // namespace

// Unfinished 16 MiB frames, 4 MiB frames of nils, 2,000 idle connections; 1,024 descriptors.
TEST(STWClientBounds, HostileClientsNeitherFreezeNorExhaustTheDaemon) {
    if (geteuid() != 0)
        GTEST_SKIP() << "needs root to open connections as another user";
    STWDaemonProcess daemon({{"DeveloperMode", STWValue(true)},
                             {"FirstFrameTimeout", STWValue(30)},
                             {"FrameTimeout", STWValue(2)}},
                            {}, false);
    daemon.setDescriptorLimit(1024);
    ASSERT_TRUE(daemon.start());
    ASSERT_TRUE(freshClientAnswered(daemon));
    size_t baseline = residentMiB(daemon.pid());

    std::vector<int> fds;
    // Opens `count` connections and sends `bytes` on all of them at once.
    auto sendOnEach = [&](int count, const std::string& bytes) {
        std::vector<std::thread> senders;
        for (int i = 0; i < count; i++) {
            fds.push_back(daemon.connectRaw());
            senders.emplace_back([fd = fds.back(), &bytes] { STWFrameWrite(fd, bytes); });
        }
        for (auto& t : senders)
            t.join();
    };
    auto closeAll = [&] {
        for (int fd : fds)
            close(fd);
        fds.clear();
    };
    std::string unfinished = frameHeader(16 * kMiB) + std::string(16 * kMiB - 1, 'x');
    survive(daemon, baseline, "16 MiB frames", [&] { sendOnEach(40, unfinished); }, closeAll);
    // [0, 1, {"K": [nil, nil, ...]}]
    uint32_t count = 4 * kMiB - 11;
    std::string nils = frameHeader(4 * kMiB) + std::string("\x93\x00\x01\x81\xa1K\xdd", 7) +
                       frameHeader(__builtin_bswap32(count)) + std::string(count, '\xc0');
    survive(daemon, baseline, "4 MiB of nils", [&] { sendOnEach(32, nils); }, closeAll);

    // A process of the mobile user opens 2,000 connections and sends nothing.
    int ready[2], done[2];
    ASSERT_EQ(pipe(ready), 0);
    ASSERT_EQ(pipe(done), 0);
    pid_t child = -1;
    survive(daemon, baseline, "2,000 idle connections",
        [&] {
            child = fork();
            if (child == 0) {
                close(done[1]);
                rlimit limit{4096, 4096};
                if (setrlimit(RLIMIT_NOFILE, &limit) != 0 || setgroups(0, nullptr) != 0 || setgid(501) != 0 ||
                    setuid(501) != 0)
                    _exit(1);
                int opened = 0;
                for (int i = 0; i < 2000; i++)
                    opened += daemon.connectRaw() >= 0;
                char c = opened == 2000 ? 'y' : 'n';
                (void)!write(ready[1], &c, 1);
                (void)!read(done[0], &c, 1);
                _exit(0);
            }
            char c = 0;
            EXPECT_EQ(read(ready[0], &c, 1), 1);
            EXPECT_EQ(c, 'y') << "the child could not open its connections";
        },
        [&] {
            close(done[1]);
            int status = 0;
            waitpid(child, &status, 0);
            EXPECT_EQ(status, 0);
        });
    for (int fd : {ready[0], ready[1], done[0]})
        close(fd);
}

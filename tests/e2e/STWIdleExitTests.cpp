#include "client/STWClient.h"
#include "Daemon/FileSystem/STWFileManager.h"
#include "platform/STWPlatformConfiguration.h"

#include <gtest/gtest.h>

#include <chrono>
#include <csignal>
#include <fstream>
#include <semaphore.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

using namespace std::chrono_literals;

namespace {

// Waits up to `limit` for the process to end; its exit status, or -1 while it runs.
int waitForExit(pid_t pid, std::chrono::milliseconds limit) {
    auto deadline = std::chrono::steady_clock::now() + limit;
    while (std::chrono::steady_clock::now() < deadline) {
        int status = 0;
        if (waitpid(pid, &status, WNOHANG) == pid)
            return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
        std::this_thread::sleep_for(20ms);
    }
    return -1;
}

} // namespace

// With an idle time (60 s by default under socket activation) the daemon leaves when
// nothing is left to do: no connection and no open transaction for that long. An open
// connection keeps it.
TEST(STWIdleExit, LeavesOnlyWhenNoConnectionIsLeft) {
    char templ[] = "/tmp/stowly-idle-XXXXXX";
    ASSERT_NE(mkdtemp(templ), nullptr);
    std::filesystem::path root = templ;
    std::filesystem::create_directories(root / "etc/stowly");
    std::ofstream(root / "etc/passwd") << "mobile:x:501:501:Mobile:/private/var/mobile:/bin/sh\n";
    pid_t pid = fork();
    if (pid == 0) {
        execl(STOWLYD_PATH, "stowlyd", "--root", root.c_str(), "--idle-timeout", "1", nullptr);
        _exit(127);
    }
    std::unique_ptr<STWClient> client;
    for (int i = 0; i < 250 && !client; i++) {
        std::this_thread::sleep_for(20ms);
        client = STWClient::connect(STWClient::socketPathForRoot(root), nullptr);
    }
    ASSERT_NE(client, nullptr);
    EXPECT_EQ(waitForExit(pid, 2500ms), -1) << "left while a client was connected";
    client.reset();
    EXPECT_EQ(waitForExit(pid, 10s), 0);
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, WNOHANG);
    sem_unlink(STWPlatformConfiguration(root).firstBootSemaphoreName().c_str());
    STWFileManager::defaultManager()->removeItemAtURL(root);
}

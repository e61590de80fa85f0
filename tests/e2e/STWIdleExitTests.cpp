#include "client/STWClient.h"
#include "tests/support/STWDaemonProcess.h"

#include <gtest/gtest.h>

#include <chrono>
#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

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

// A listening Unix socket of `type` bound at `path`, as the service manager passes them.
int listeningSocket(const std::filesystem::path& path, int type) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    int fd = socket(AF_UNIX, type | SOCK_CLOEXEC, 0);
    if (fd >= 0 &&
        (bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 || listen(fd, 16) != 0)) {
        close(fd);
        return -1;
    }
    return fd;
}

} // namespace

// Started by the service manager, the daemon serves the passed socket named "stowlyd.sock"
// and leaves after its idle time without connections (an open one keeps it); a connection
// made while no daemon ran is served by the next one, started on the same sockets.
TEST(STWIdleExit, LeavesOnlyWhenNoConnectionIsLeft) {
    STWDaemonProcess prepared({}, {}, false); // only its root, cleaned up at the end
    const std::filesystem::path& root = prepared.root();
    int upcall = listeningSocket(root / "upcall.sock", SOCK_SEQPACKET);
    int request = listeningSocket(root / "activated.sock", SOCK_STREAM);
    ASSERT_GE(upcall, 0);
    ASSERT_GE(request, 0);
    std::vector<std::string> environment{"LISTEN_FDS=2", "LISTEN_FDNAMES=upcall:stowlyd.sock"};
    for (char** variable = environ; *variable; variable++)
        environment.emplace_back(*variable);
    char listenPID[32] = "LISTEN_PID=";
    std::vector<char*> envp{listenPID};
    for (std::string& variable : environment)
        envp.push_back(variable.data());
    envp.push_back(nullptr);
    auto activate = [&] {
        pid_t pid = fork();
        if (pid == 0) {
            // Passed sockets start at descriptor 3, in the order of their names.
            int first = fcntl(upcall, F_DUPFD, 10), second = fcntl(request, F_DUPFD, 10);
            if (first < 0 || second < 0 || dup2(first, 3) != 3 || dup2(second, 4) != 4)
                _exit(126);
            snprintf(listenPID, sizeof listenPID, "LISTEN_PID=%d", getpid());
            execle(STOWLYD_PATH, "stowlyd", "--root", root.c_str(), "--idle-timeout", "1", nullptr, envp.data());
            _exit(127);
        }
        return pid;
    };
    pid_t pid = activate();
    auto client = STWClient::connect(root / "activated.sock", nullptr);
    ASSERT_NE(client, nullptr);
    EXPECT_NE(STWDaemonProcess::replyError(*client, 0), 0u) << "no answer on the passed request socket";
    EXPECT_EQ(waitForExit(pid, 2500ms), -1) << "left while a client was connected";
    client.reset();
    EXPECT_EQ(waitForExit(pid, 10s), 0);
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, WNOHANG);

    // The next client connects while no daemon runs and waits in the socket's backlog.
    client = STWClient::connect(root / "activated.sock", nullptr);
    ASSERT_NE(client, nullptr) << "the socket did not outlive the daemon";
    pid = activate();
    EXPECT_NE(STWDaemonProcess::replyError(*client, 0), 0u) << "no answer after the second activation";
    client.reset();
    EXPECT_EQ(waitForExit(pid, 10s), 0) << "the second activation did not leave when idle";
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, WNOHANG);
    close(upcall);
    close(request);
}

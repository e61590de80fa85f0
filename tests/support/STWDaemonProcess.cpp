#include "tests/support/STWDaemonProcess.h"
#include "Daemon/FileSystem/STWFileManager.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWFileIO.h"
#include "common/STWPropertyList.h"
#include "platform/STWPlatformConfiguration.h"

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <fstream>
#include <mutex>
#include <poll.h>
#include <semaphore.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

namespace {

std::mutex failureHandlerLock;
std::function<void(const std::string&)> failureHandler;

std::string describeStatus(int status) {
    if (WIFEXITED(status))
        return "exit status " + std::to_string(WEXITSTATUS(status));
    if (WIFSIGNALED(status))
        return "signal " + std::to_string(WTERMSIG(status));
    return "status " + std::to_string(status);
}

} // namespace

void STWDaemonProcess::setFailureHandler(std::function<void(const std::string&)> handler) {
    std::lock_guard guard(failureHandlerLock);
    failureHandler = std::move(handler);
}

void STWDaemonProcess::_fail(const std::string& message) {
    std::function<void(const std::string&)> handler;
    {
        std::lock_guard guard(failureHandlerLock);
        handler = failureHandler;
    }
    if (handler)
        handler(message);
    else
        fprintf(stderr, "STWDaemonProcess: %s\n", message.c_str());
}

STWDaemonProcess::STWDaemonProcess(STWValue::Dictionary settings, STWValue::Array personas, bool start) {
    char templ[] = "/tmp/stowly-e2e-XXXXXX";
    if (!mkdtemp(templ))
        abort();
    _root = templ;
    std::filesystem::permissions(_root, std::filesystem::perms(0755));
    std::filesystem::create_directories(_root / "etc/stowly");
    std::ofstream(_root / "etc/passwd") << "root:x:0:0:root:/private/var/root:/bin/sh\n"
                                           "mobile:x:501:501:Mobile:/private/var/mobile:/bin/sh\n";
    std::ofstream(_root / "etc/group") << "root:x:0:\nmobile:x:501:\nsystemusers:x:950:mobile\n";
    // A system that names no build is taken to be upgraded at every power-on.
    std::ofstream(_root / "etc/os-release") << "BUILD_ID=stowly-test\n";
    if (!STW_writeToURL(settings, _root / "etc/stowly/stowlyd.plist", STWWriteAtomic, nullptr))
        abort();
    if (!personas.empty() && STWWriteFileAtomically(_root / "etc/stowly/personas.plist",
                                                    STWPropertyList::serializeBinary(STWValue(personas)), 0644,
                                                    false) != 0)
        abort();
    if (start)
        this->start();
}

STWDaemonProcess::~STWDaemonProcess() {
    if (_pid > 0)
        stop();
    // The first-boot marker lives outside the root; a daemon of another root never shares it.
    reboot();
    STWFileManager::defaultManager()->removeItemAtURL(_root);
}

void STWDaemonProcess::reboot() { sem_unlink(STWPlatformConfiguration(_root).firstBootSemaphoreName().c_str()); }

bool STWDaemonProcess::waitForCleanups(bool firstBoot, std::chrono::milliseconds limit) {
    std::filesystem::path run = _root / "run/stowly";
    auto deadline = std::chrono::steady_clock::now() + limit;
    while (!(std::filesystem::exists(run / "cleanup-complete") &&
             (!firstBoot || std::filesystem::exists(run / "reboot-cleanup-complete")))) {
        if (std::chrono::steady_clock::now() >= deadline || !isRunning()) {
            _fail("the cleanups of " + _root.string() + " did not finish");
            return false;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return true;
}

bool STWDaemonProcess::startWith(const char* variable, const std::string& value) {
    setenv(variable, value.c_str(), 1);
    bool started = start();
    unsetenv(variable);
    return started;
}

bool STWDaemonProcess::killedItself() {
    std::optional<int> status = waitForExit(timeout);
    return status && WIFSIGNALED(*status) && WTERMSIG(*status) == SIGKILL;
}

bool STWDaemonProcess::start() {
    if (_pid > 0 && isRunning())
        return true;
    _exitStatus.reset();
    // A daemon that was killed leaves the completion files of its cleanups; the new one
    // withdraws them only once it runs, so they go now, and waitForCleanups sees this start's.
    for (const char* name : {"cleanup-complete", "reboot-cleanup-complete"})
        unlink((_root / "run/stowly" / name).c_str());
    _pid = fork();
    if (_pid == 0) {
        if (_standardErrorFile) {
            int fd = open(_standardErrorFile->c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
            if (fd < 0 || dup2(fd, STDERR_FILENO) < 0)
                _exit(126);
        }
        if (_descriptorLimit) {
            rlimit limit{*_descriptorLimit, *_descriptorLimit};
            if (setrlimit(RLIMIT_NOFILE, &limit) != 0)
                _exit(126);
        }
        execl(STOWLYD_PATH, "stowlyd", "--root", _root.c_str(), "--idle-timeout", "0", nullptr);
        _exit(127);
    }
    auto deadline = std::chrono::steady_clock::now() + timeout;
    while (std::chrono::steady_clock::now() < deadline && isRunning()) {
        if (STWClient::connect(socketPath(), nullptr))
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    _fail("stowlyd did not start on " + _root.string() +
          (_exitStatus ? " (" + describeStatus(*_exitStatus) + ")" : std::string()));
    return false;
}

bool STWDaemonProcess::stop() {
    if (_pid <= 0)
        return false;
    int status = 0;
    if (_exitStatus) {
        status = *_exitStatus;
    } else {
        kill(_pid, SIGTERM);
        auto deadline = std::chrono::steady_clock::now() + stopTimeout;
        while (waitpid(_pid, &status, WNOHANG) == 0) {
            if (std::chrono::steady_clock::now() >= deadline) {
                kill(_pid, SIGKILL);
                waitpid(_pid, &status, 0);
                _pid = -1;
                _fail("stowlyd did not stop within " + std::to_string(stopTimeout.count()) + " s of SIGTERM");
                return false;
            }
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
    }
    _pid = -1;
    _exitStatus.reset();
    bool clean = WIFEXITED(status) && WEXITSTATUS(status) == 0;
    if (!clean)
        _fail("stowlyd ended with " + describeStatus(status));
    return clean;
}

std::optional<int> STWDaemonProcess::waitForExit(std::chrono::milliseconds timeout) {
    auto deadline = std::chrono::steady_clock::now() + timeout;
    while (isRunning() && std::chrono::steady_clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    if (!_exitStatus)
        return std::nullopt;
    std::optional<int> status = _exitStatus;
    _pid = -1;
    _exitStatus.reset();
    return status;
}

bool STWDaemonProcess::isRunning() {
    if (_pid <= 0 || _exitStatus)
        return false;
    // A daemon that has ended is reaped here; its status is kept for stop() to report.
    int status = 0;
    if (waitpid(_pid, &status, WNOHANG) == 0)
        return true;
    _exitStatus = status;
    return false;
}

std::unique_ptr<STWClient> STWDaemonProcess::connect() {
    STWErrorRef error;
    auto client = STWClient::connect(socketPath(), &error);
    if (!client)
        _fail("cannot connect to " + socketPath().string() + ": " + (error ? error->description() : ""));
    return client;
}

int STWDaemonProcess::connectRaw() const {
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::string path = socketPath();
    if (fd < 0 || path.size() >= sizeof address.sun_path)
        return -1;
    memcpy(address.sun_path, path.c_str(), path.size() + 1);
    if (::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
        close(fd);
        return -1;
    }
    return fd;
}

bool STWDaemonProcess::closedByDaemon(int fd, std::chrono::milliseconds limit) {
    char buffer[4096];
    auto deadline = std::chrono::steady_clock::now() + limit;
    while (std::chrono::steady_clock::now() < deadline) {
        pollfd p{fd, POLLIN, 0};
        if (poll(&p, 1, 100) <= 0)
            continue;
        if (recv(fd, buffer, sizeof buffer, 0) <= 0)
            return true;
    }
    return false;
}

std::unique_ptr<STWClient> STWDaemonProcess::connectAs(const std::string& identifier,
                                                      STWValue::Dictionary entitlements, bool sandboxed,
                                                      std::optional<std::string> persona) {
    auto client = connect();
    if (!client)
        return nullptr;
    STWErrorRef error;
    STWValue::Dictionary hello{{"CodeSigningIdentifier", STWValue(identifier)},
                               {"Entitlements", STWValue(std::move(entitlements))},
                               {"Sandboxed", STWValue(sandboxed)}};
    if (persona)
        hello["PersonaUniqueString"] = STWValue(*persona);
    auto code = client->hello(hello, timeout, &error);
    if (code.value_or(0) != STWErrorSuccess)
        _fail("hello as " + identifier + " answered " + (code ? std::to_string(*code) : std::string("nothing")) +
              (error ? ": " + error->description() : std::string()));
    return client;
}

STWValue::Dictionary STWDaemonProcess::send(STWClient& client, uint64_t command, STWValue::Dictionary keys) {
    keys["Command"] = STWValue(command);
    STWErrorRef error;
    auto reply = client.sendMessage(keys, timeout, &error);
    return reply ? *reply : STWValue::Dictionary{};
}

uint64_t STWDaemonProcess::replyError(STWClient& client, uint64_t command, STWValue::Dictionary keys) {
    return STWDictionaryUInt64(send(client, command, std::move(keys)), "ReplyError").value_or(0);
}

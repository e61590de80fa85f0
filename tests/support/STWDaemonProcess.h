// A real stowlyd on a private root prefix of its own, for the end-to-end tests and the
// benchmarks, which talk to it over its socket as a client would. The root has an
// etc/passwd with the "mobile" user (501), a "systemusers" group and an etc/os-release
// naming one build (so that only the first power-on is a build upgrade); the daemon is stopped
// with SIGTERM, its first-boot semaphore unlinked and the root removed at the end.
//
// The root outlives the daemon, so a caller can lay out containers before the first start
// and restart the daemon on what it left behind. Problems (a daemon that does not start or
// exits uncleanly, a refused connection or hello) go to the failure handler: the tests turn
// them into test failures, the default prints them.
#pragma once

#include "client/STWClient.h"
#include "common/STWValue.h"

#include <chrono>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <sys/resource.h>
#include <sys/types.h>

class STWDaemonProcess {
public:
    // Prepares the root with `settings` as its stowlyd.plist (and `personas`, when given, as
    // its persona list) and, unless told not to, starts the daemon and waits until it answers.
    explicit STWDaemonProcess(STWValue::Dictionary settings, STWValue::Array personas = {}, bool start = true);
    ~STWDaemonProcess();
    STWDaemonProcess(const STWDaemonProcess&) = delete;
    STWDaemonProcess& operator=(const STWDaemonProcess&) = delete;

    const std::filesystem::path& root() const { return _root; }
    std::filesystem::path socketPath() const { return _root / "run/stowly/stowlyd.sock"; }
    pid_t pid() const { return _pid; }
    bool isRunning();

    // Starts the daemon on the root and waits until its socket accepts connections.
    bool start();
    // SIGTERM, then waits for the exit; true when the daemon exited with status 0 within
    // stopTimeout. One that did not is killed (and counts as a failure).
    bool stop();
    // start() with one variable set in the daemon's environment only (STOWLY_CRASH_AT or
    // STOWLY_FAULT, which a daemon whose configuration says InternalImage honours).
    bool startWith(const char* variable, const std::string& value);
    // Waits for a daemon armed at a crash point to kill itself there: true when it died of
    // SIGKILL within the time-out.
    bool killedItself();
    // Waits for a daemon that is to end by itself (at a crash point, say) and answers its
    // wait status, or nullopt when it still runs after `timeout`; no failure is reported.
    std::optional<int> waitForExit(std::chrono::milliseconds timeout);
    // A power cycle as the daemon sees it: its first-boot semaphore goes, so its next start
    // is the first since power-on (and runs the first-boot setup and cleanup).
    void reboot();
    // Waits until the cleanups of the running daemon's start have finished, as their
    // completion files say: the every-start cleanup, and with `firstBoot` the first-boot one.
    bool waitForCleanups(bool firstBoot = false, std::chrono::milliseconds limit = timeout);
    // Where the daemon's standard error (its system log off systemd) goes from the next
    // start on; by default it is ours.
    void setStandardErrorFile(std::filesystem::path file) { _standardErrorFile = std::move(file); }
    // The descriptor limit (soft and hard) the daemon starts with from the next start on;
    // by default it inherits ours.
    void setDescriptorLimit(rlim_t limit) { _descriptorLimit = limit; }

    // A connection that declared `identifier` with `entitlements` (developer mode).
    std::unique_ptr<STWClient> connectAs(const std::string& identifier, STWValue::Dictionary entitlements,
                                         bool sandboxed = false, std::optional<std::string> persona = std::nullopt);
    std::unique_ptr<STWClient> connect();
    // A bare socket connected to the daemon, for tests that speak bytes rather than
    // frames; -1 on failure. The caller closes it.
    int connectRaw() const;
    // True when the daemon closes `fd` (end of stream) within `limit`; whatever it sent
    // before closing is skipped.
    static bool closedByDaemon(int fd, std::chrono::milliseconds limit = timeout);

    // Sends one command and answers its "ReplyError" (0 when no reply came).
    static uint64_t replyError(STWClient& client, uint64_t command, STWValue::Dictionary keys = {});
    // Sends one command and answers its whole reply (empty when none came).
    static STWValue::Dictionary send(STWClient& client, uint64_t command, STWValue::Dictionary keys = {});

    static void setFailureHandler(std::function<void(const std::string&)> handler);

    static constexpr std::chrono::seconds timeout{10};
    // Above the daemon's own bound on stopping (10 s for connections and posted work).
    static constexpr std::chrono::seconds stopTimeout{15};

private:
    static void _fail(const std::string& message);

    std::filesystem::path _root;
    pid_t _pid = -1;
    std::optional<int> _exitStatus; // of a daemon that ended while we looked, before stop()
    std::optional<std::filesystem::path> _standardErrorFile;
    std::optional<rlim_t> _descriptorLimit;
};

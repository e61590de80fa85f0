// A real stowlyd on a private root prefix of its own, for tests that talk to it over its
// socket as a client would. The root has an etc/passwd with the "mobile" user (501) and a
// "systemusers" group; the daemon is stopped with SIGTERM and the root removed at the end.
#pragma once

#include "client/STWClient.h"
#include "common/STWValue.h"

#include <chrono>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <sys/types.h>

class STWDaemonProcess {
public:
    // Starts the daemon with `settings` as its stowlyd.plist (and `personas`, when given, as
    // its persona list) and waits until it answers.
    explicit STWDaemonProcess(STWValue::Dictionary settings, STWValue::Array personas = {});
    ~STWDaemonProcess();

    const std::filesystem::path& root() const { return _root; }
    std::filesystem::path socketPath() const { return _root / "run/stowly/stowlyd.sock"; }
    bool isRunning();

    // A connection that declared `identifier` with `entitlements` (developer mode).
    std::unique_ptr<STWClient> connectAs(const std::string& identifier, STWValue::Dictionary entitlements,
                                         bool sandboxed = false, std::optional<std::string> persona = std::nullopt);
    std::unique_ptr<STWClient> connect();

    // Sends one command and answers its "ReplyError" (0 when no reply came).
    static uint64_t replyError(STWClient& client, uint64_t command, STWValue::Dictionary keys = {});
    // Sends one command and answers its whole reply (empty when none came).
    static STWValue::Dictionary send(STWClient& client, uint64_t command, STWValue::Dictionary keys = {});

    static constexpr std::chrono::seconds timeout{10};

private:
    std::filesystem::path _root;
    pid_t _pid = -1;
};

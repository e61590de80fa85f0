// The audit token of a process: eight 32-bit words that name one process for its whole
// life. A pid alone can be recycled; the start time in word 7 makes a restarted or
// recycled process a different token.
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <sys/types.h>

struct STWAuditToken {
    // auid, euid, egid, ruid, rgid, pid, session id, low 32 bits of the start time.
    std::array<uint32_t, 8> words{};

    // The token of a live process, read from /proc. `euid` and `egid` come from the
    // caller (the socket's peer credentials, which are what the peer connected with).
    static std::optional<STWAuditToken> forProcess(pid_t pid, uid_t euid, gid_t egid);

    pid_t pid() const { return static_cast<pid_t>(words[5]); }
    uid_t euid() const { return words[1]; }
    gid_t egid() const { return words[2]; }
    bool isZero() const;
    bool operator==(const STWAuditToken&) const = default;
    std::string description() const;
};

// One run of stowlyctl: the global options, the connection to the daemon and the output.
//
// Subcommands build a message and hand it to send(), which connects (saying hello first
// when --as is given), waits for the reply and prints it, so that a subcommand is little
// more than the keys of its message.
#pragma once

#include "common/STWValue.h"

#include <chrono>
#include <filesystem>
#include <optional>
#include <string>

// Exit statuses.
enum : int {
    STWCTLExitSuccess = 0,
    STWCTLExitReplyError = 1, // the daemon answered with a ReplyError other than 1
    STWCTLExitConnection = 2, // no answer: connect, send, receive or time-out failed
    STWCTLExitUsage = 64,     // bad arguments or input files
};

struct STWCTLOptions {
    std::string root;             // --root, "" when not given
    std::string socket;           // --socket, "" when not given
    std::string identifier;       // --as, "" when not given
    std::string entitlementsPath; // --entitlements
    bool sandboxed = false;       // --sandboxed
    std::string persona;          // --persona
    bool json = false;            // --json
    double timeoutSeconds = 30;   // --timeout
};

class STWCTLSession {
public:
    STWCTLOptions options;

    // The root prefix the daemon runs on: --root, else "/".
    std::filesystem::path root() const;
    // --socket, else the socket under --root, else the production socket.
    std::filesystem::path socketPath() const;

    // --timeout as a duration; nullopt when it is not a positive number of seconds.
    std::optional<std::chrono::milliseconds> timeout() const;

    // Sends `message`, prints the reply and returns the exit status.
    int send(const STWValue::Dictionary& message);

    // Prints a result that did not come from the daemon, in the chosen format.
    void print(const STWValue::Dictionary& result) const;

    // Reports a bad argument: "stowlyctl: <message>" on standard error.
    int usageError(const std::string& message) const;
};

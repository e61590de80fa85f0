// libstowly's side of the upcall socket: sends get-process-containers requests as the
// kernel's sandbox does and reads the replies, for stowlyctl, the tests and the
// benchmarks. The socket is root's alone (see STWUpcallListener).
//
// One STWUpcallClient is one connection; one request at a time (not thread-safe). Failures
// are POSIX-domain errors: the errno of a failed connect or send, ETIMEDOUT when no reply
// came in time, ECONNRESET when the daemon closed the connection, EBADMSG for a reply
// that is neither reply form.
#pragma once

#include "common/STWError.h"
#include "common/STWFileDescriptor.h"
#include "upcall/STWKernProcessContainers.h"

#include <chrono>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

class STWUpcallClient {
public:
    // What the kernel asks for; absent items are not packed.
    struct Request {
        std::optional<std::string> codeSignatureIdentifier;
        std::optional<std::string> containerIdentifier;
        std::optional<uint32_t> uid;
        std::vector<std::string> appGroupIdentifiers;
        std::optional<uint32_t> containerType;
        std::optional<std::string> systemContainerIdentifier;
        std::vector<std::string> systemGroupIdentifiers;
        std::optional<uint32_t> personaID;
    };
    // The return code of an error reply (nothing else set), or 0 and the items of a success reply.
    struct Reply : STWKernProcessContainersReply {
        STWKernReturn returnCode = STWKernSuccess;
    };

    // The upcall socket of a daemon started with --root `root`.
    static std::filesystem::path socketPathForRoot(const std::filesystem::path& root);
    static std::unique_ptr<STWUpcallClient> connect(const std::filesystem::path& socketPath, STWErrorRef* error);

    // The request buffer of `request`.
    static std::string packedBufferForRequest(const Request& request);
    // A request packet: the 56-byte layout for `messageID` followed by `packedBuffer`.
    static std::string packetWithBuffer(std::string_view packedBuffer,
                                        uint32_t messageID = STWKernGetProcessContainersID);
    // The items of a reply packet; nullopt with EBADMSG when it is not one.
    static std::optional<Reply> replyFromPacket(std::string_view packet, STWErrorRef* error);

    // Sends one packet and answers the next packet that comes back.
    std::optional<std::string> exchangePacket(std::string_view packet, std::chrono::milliseconds timeout,
                                              STWErrorRef* error);
    std::optional<Reply> send(const Request& request, std::chrono::milliseconds timeout, STWErrorRef* error);

    int fd() const { return _fd.get(); }

private:
    explicit STWUpcallClient(STWFileDescriptor fd) : _fd(std::move(fd)) {}

    STWFileDescriptor _fd;
};

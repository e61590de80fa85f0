// The packed buffers of the get-process-containers routine: the request the kernel sends,
// decoded, and the paths the server answers with, packed.
//
// Both halves are plain values without any container work, so that the server, the
// fuzzer and the tests share the one decoder and the one packer. Decoding hands out
// copies; the request memory may be released as soon as decode() returns. Log lines carry
// the routine's name, server_get_process_containers, whose steps these are.
#pragma once

#include "upcall/STWKernMessages.h"

#include <optional>
#include <string>
#include <utility>
#include <vector>

struct STWKernProcessContainersRequest {
    std::optional<std::string> codeSignatureIdentifier;
    std::optional<std::string> containerIdentifier;
    std::optional<std::string> applicationIdentifier; // read, never used
    uint32_t uid = 0;
    std::vector<std::string> appGroupIdentifiers;
    uint32_t containerType = STWKernContainerTypeApplication;
    std::optional<std::string> systemContainerIdentifier;
    std::vector<std::string> systemGroupIdentifiers;
    uint32_t personaID = 0;

    // The container id when there is one, else the code-signing id.
    const std::optional<std::string>& identifier() const {
        return containerIdentifier ? containerIdentifier : codeSignatureIdentifier;
    }

    // Reads `size` bytes of request buffer. A singular tag that occurs twice keeps the
    // later value; the group tags add to their lists. 0, or the routine's code: 9 when the
    // buffer cannot be wrapped, 5 for an item of the wrong kind, 4 for an unknown tag.
    static STWKernReturn decode(const void* memory, uint32_t size, STWKernProcessContainersRequest* request);
};

struct STWKernProcessContainersReply {
    // 1 when every container was made; with 0 only the status is packed.
    uint32_t status = 1;
    std::optional<std::string> homeDirectory;
    std::optional<std::string> dataContainer;
    std::optional<std::string> tempDirectory;
    std::vector<std::pair<std::string, std::string>> appGroups; // identifier, path
    std::optional<std::string> systemContainer;
    std::vector<std::pair<std::string, std::string>> systemGroups;

    // Packs the paths in reply order while status is 1 (a path that cannot be packed
    // turns status to 0 and ends the paths), then the status, and hands out the packed
    // buffer's own memory, which STWKernReleaseReplyMemory() releases once the reply is
    // sent. 0, 9 when no buffer can be made, or 6 when its memory cannot be handed out
    // (none is then).
    STWKernReturn copyOut(void** memory, uint32_t* size, bool* deallocate) const;
};

void STWKernReleaseReplyMemory(void* memory, uint32_t size);

// Serves any input as a packet from the kernel, through the transport, the message layer,
// the request decoder and the reply builder, and reads the reply back as libstowly does.
// The routine here answers from the decoded request alone (fixed paths derived from its
// identifiers) instead of making containers, so that every reply can be checked against
// what the request asked for.
#include "client/STWUpcallClient.h"
#include "upcall/STWKernProcessContainers.h"
#include "upcall/STWKernServer.h"
#include "upcall/STWKernTransport.h"

#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace {

STWKernProcessContainersRequest lastRequest;

void require(bool condition, const char* what) {
    if (!condition) {
        fprintf(stderr, "upcall fuzzer: %s\n", what);
        abort();
    }
}

std::string pathFor(const char* kind, const std::string& identifier) { return std::string(kind) + identifier; }

// What a pair packed from (identifier, path) reads back as: key items end at the first NUL.
std::pair<std::string, std::string> asPacked(const std::string& identifier, const std::string& path) {
    return {identifier.c_str(), path.c_str()};
}

} // namespace

STWKernReturn server_get_process_containers(const void* request, uint32_t requestSize, STWAuditToken auditToken,
                                            void** reply, uint32_t* replySize, bool* deallocate) {
    if (auditToken.pid() != 0)
        return STWKernFailure;
    lastRequest = {};
    if (STWKernReturn code = STWKernProcessContainersRequest::decode(request, requestSize, &lastRequest))
        return code;
    STWKernProcessContainersReply containers;
    containers.homeDirectory = "/home";
    if (const auto& identifier = lastRequest.identifier()) {
        containers.dataContainer = pathFor("/data/", *identifier);
        containers.tempDirectory = pathFor("/data/", *identifier) + "/tmp";
    }
    for (const std::string& group : lastRequest.appGroupIdentifiers)
        containers.appGroups.emplace_back(group, pathFor("/group/", group));
    if (lastRequest.systemContainerIdentifier)
        containers.systemContainer = pathFor("/system/", *lastRequest.systemContainerIdentifier);
    for (const std::string& group : lastRequest.systemGroupIdentifiers)
        containers.systemGroups.emplace_back(group, pathFor("/systemgroup/", group));
    return containers.copyOut(reply, replySize, deallocate);
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    // Exactly the input's bytes, so that any read past them is caught.
    std::unique_ptr<char[]> packet(new char[size]);
    memcpy(packet.get(), data, size);
    STWAuditToken kernel;
    kernel.words[5] = 4242; // the transport makes it 0: a root peer is the kernel
    std::string reply;
    if (!STWKernServePacket(std::string_view(packet.get(), size), kernel, 1, &reply)) {
        uint32_t id = 0;
        if (size >= sizeof(STWKernHeader))
            memcpy(&id, data + offsetof(STWKernHeader, id), sizeof id);
        require(size < sizeof(STWKernHeader) || (id != STWKernGetProcessContainersID && id != STWKernUnusedRoutineID),
                "a message of the subsystem got no reply");
        return 0;
    }
    STWErrorRef error;
    auto read = STWUpcallClient::replyFromPacket(reply, &error);
    require(read.has_value(), "the reply does not read back");
    if (read->returnCode != STWKernSuccess)
        return 0;
    require(read->status == 1u, "the reply's status is not 1");
    std::vector<std::pair<std::string, std::string>> groups, systemGroups;
    for (const std::string& group : lastRequest.appGroupIdentifiers)
        groups.push_back(asPacked(group, pathFor("/group/", group)));
    for (const std::string& group : lastRequest.systemGroupIdentifiers)
        systemGroups.push_back(asPacked(group, pathFor("/systemgroup/", group)));
    require(read->appGroups == groups, "app groups changed on the way");
    require(read->systemGroups == systemGroups, "system groups changed on the way");
    require(read->homeDirectory == "/home", "home changed on the way");
    require(read->dataContainer.has_value() == lastRequest.identifier().has_value(), "data container lost");
    return 0;
}

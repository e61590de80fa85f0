#include "upcall/STWKernTransport.h"

#include "upcall/STWKernProcessContainers.h"
#include "upcall/STWKernServer.h"

#include <algorithm>
#include <cstring>

bool STWKernServePacket(std::string_view packet, const STWAuditToken& peerToken, uint32_t sequence,
                        std::string* reply) {
    if (packet.size() < sizeof(STWKernHeader))
        return false;
    STWKernReceivedRequest received{};
    memcpy(&received.request, packet.data(), std::min(packet.size(), sizeof(STWKernRequest)));
    if (packet.size() < sizeof(STWKernRequest)) {
        received.request.header.size = static_cast<uint32_t>(packet.size());
    } else {
        std::string_view data = packet.substr(sizeof(STWKernRequest));
        received.request.data.address = data.empty() ? 0 : reinterpret_cast<uintptr_t>(data.data());
        received.request.data.size = static_cast<uint32_t>(data.size());
    }
    STWKernTrailer& trailer = received.trailer;
    trailer.type = STWKernTrailerFormat0;
    trailer.size = sizeof(STWKernTrailer);
    trailer.sequence = sequence;
    trailer.securityToken[0] = peerToken.euid();
    trailer.securityToken[1] = peerToken.egid();
    trailer.auditToken = peerToken;
    if (peerToken.euid() == 0)
        trailer.auditToken.words[5] = 0;

    STWKernReply answer{};
    bool handled = demux_server(&received.request.header, &answer.header);
    if (!handled && answer.header.size == 0)
        return false;
    if (!(answer.header.bits & STWKernMessageBitsComplex)) {
        reply->assign(reinterpret_cast<const char*>(&answer.error), sizeof answer.error);
        return true;
    }
    STWKernSuccessReply success = answer.success;
    auto* memory = reinterpret_cast<char*>(static_cast<uintptr_t>(success.data.address));
    success.data.address = 0;
    reply->assign(reinterpret_cast<const char*>(&success), sizeof success);
    reply->append(memory, success.data.size);
    if (success.data.deallocate)
        STWKernReleaseReplyMemory(memory, success.data.size);
    return true;
}

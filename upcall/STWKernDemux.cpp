// The message layer of the upcall server: which messages it takes, the checks of their
// layout, and the two forms of reply.
#include "upcall/STWKernServer.h"

#include "common/STWLog.h"

namespace {

void signpost(const char* interval, bool begin) {
    STW_LOG_DEBUG(STWLogCategory::Upcall, "%s %s", begin ? "begin" : "end", interval);
}

// 0 when the routine may read the request, else the message layer's code.
STWKernReturn checkRequest(const STWKernReceivedRequest& received) {
    const STWKernRequest& request = received.request;
    if (!(request.header.bits & STWKernMessageBitsComplex) || request.descriptorCount != 1 ||
        request.header.size != sizeof(STWKernRequest))
        return STWKernMIGBadArguments;
    if (request.data.type != STWKernDescriptorTypeOutOfLine || request.data.size != request.dataCount)
        return STWKernMIGTypeError;
    if (received.trailer.type != STWKernTrailerFormat0 || received.trailer.size < STWKernMinTrailerSize)
        return STWKernMIGTrailerError;
    return STWKernSuccess;
}

} // namespace

bool demux_server(STWKernHeader* requestHeader, STWKernHeader* replyHeader) {
    STW_LOG_DEBUG(STWLogCategory::Upcall, "in demux_server(); request->msgh_id: %d",
                  static_cast<int32_t>(requestHeader->id));
    if (requestHeader->id != STWKernGetProcessContainersID && requestHeader->id != STWKernUnusedRoutineID)
        return false;
    STW_LOG_DEBUG(STWLogCategory::Upcall, "handling incomming request for stowly server");
    // The header is the first member of both, so these name the caller's buffers.
    auto* received = reinterpret_cast<STWKernReceivedRequest*>(requestHeader);
    auto* reply = reinterpret_cast<STWKernReply*>(replyHeader);
    reply->header = {.bits = requestHeader->bits & STWKernMessageBitsRemoteMask,
                     .size = sizeof(STWKernErrorReply),
                     .remotePort = requestHeader->remotePort,
                     .localPort = 0,
                     .voucherPort = 0,
                     .id = requestHeader->id + STWKernReplyIDOffset};
    reply->error.ndr = STWKernNDRRecord;

    if (requestHeader->id == STWKernUnusedRoutineID) {
        reply->error.returnCode = STWKernMIGBadID;
        STW_LOG_DEBUG(STWLogCategory::Upcall, "stowly server returns: %d", 0);
        return false;
    }

    STWKernReturn code = checkRequest(*received);
    void* replyMemory = nullptr;
    uint32_t replySize = 0;
    bool deallocate = false;
    if (code == STWKernSuccess) {
        STWKernRequest& request = received->request;
        signpost("KernelUpcall", true);
        code = server_get_process_containers(reinterpret_cast<const void*>(request.data.address), request.dataCount,
                                             received->trailer.auditToken, &replyMemory, &replySize, &deallocate);
        signpost("KernelUpcall", false);
        // The memory is the received packet's, which its receiver releases: the descriptor
        // no longer names it.
        request.data.address = 0;
        request.data.size = 0;
    }

    if (code != STWKernSuccess) {
        reply->error.returnCode = code;
    } else {
        STWKernSuccessReply& success = reply->success;
        success.header.bits |= STWKernMessageBitsComplex;
        success.header.size = sizeof(STWKernSuccessReply);
        success.descriptorCount = 1;
        success.data = {.address = reinterpret_cast<uintptr_t>(replyMemory),
                        .deallocate = static_cast<uint8_t>(deallocate ? 1 : 0),
                        .copy = STWKernCopyVirtual,
                        .pad = 0,
                        .type = STWKernDescriptorTypeOutOfLine,
                        .size = replySize};
        success.ndr = STWKernNDRRecord;
        success.dataCount = replySize;
    }
    STW_LOG_DEBUG(STWLogCategory::Upcall, "stowly server returns: %d", 1);
    return true;
}

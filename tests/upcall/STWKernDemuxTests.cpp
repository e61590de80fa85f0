// The message layer in-process: which messages demux_server takes and the error replies it
// makes. Every case here is answered before any container work, so no daemon runs.
#include "client/STWUpcallClient.h"
#include "upcall/STWKernServer.h"

#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <tuple>

namespace {

// A well-formed request from the kernel for `buffer`, as the transport delivers it.
STWKernReceivedRequest wellFormed(const std::string& buffer) {
    STWKernReceivedRequest received{};
    std::string packet = STWUpcallClient::packetWithBuffer(buffer);
    memcpy(&received.request, packet.data(), sizeof received.request);
    received.request.header.remotePort = 0x1234;
    received.request.data.address = reinterpret_cast<uintptr_t>(buffer.data());
    received.trailer.type = STWKernTrailerFormat0;
    received.trailer.size = sizeof received.trailer;
    return received;
}

const std::string kEndMarkerOnly(8, '\0');

} // namespace

TEST(STWKernDemuxTest, BadLayoutsAndForeignIdsGetTheMessageLayersAnswers) {
    struct Case {
        const char* name;
        std::function<void(STWKernReceivedRequest&)> breakIt;
        STWKernReturn code;
        uint32_t pid = 0;
    };
    const Case cases[] = {
        {"not complex", [](auto& r) { r.request.header.bits &= ~STWKernMessageBitsComplex; }, STWKernMIGBadArguments},
        {"two descriptors", [](auto& r) { r.request.descriptorCount = 2; }, STWKernMIGBadArguments},
        {"a size other than 56", [](auto& r) { r.request.header.size = 60; }, STWKernMIGBadArguments},
        {"not out-of-line memory", [](auto& r) { r.request.data.type = 2; }, STWKernMIGTypeError},
        {"a data count that disagrees", [](auto& r) { r.request.dataCount = 16; }, STWKernMIGTypeError},
        {"another trailer format", [](auto& r) { r.trailer.type = 1; }, STWKernMIGTrailerError},
        {"a trailer too short", [](auto& r) { r.trailer.size = 28; }, STWKernMIGTrailerError},
        // Well formed, but not from the kernel: refused before the buffer is read.
        {"a process's audit token", [](auto&) {}, STWKernFailure, 4242},
    };
    for (const Case& c : cases) {
        STWKernReceivedRequest received = wellFormed(kEndMarkerOnly);
        received.trailer.auditToken.words[5] = c.pid;
        c.breakIt(received);
        STWKernReply reply{};
        EXPECT_TRUE(demux_server(&received.request.header, &reply.header)) << c.name;
        // Bits 19: the request's remote disposition; the id is the request's plus 100.
        EXPECT_EQ(std::tuple(reply.error.returnCode, reply.header.size, reply.header.bits,
                             reply.header.remotePort, reply.header.localPort, reply.header.id),
                  std::tuple(c.code, uint32_t(sizeof(STWKernErrorReply)), 19u, 0x1234u, 0u, 322515000u))
            << c.name;
        EXPECT_EQ(memcmp(&reply.error.ndr, &STWKernNDRRecord, sizeof STWKernNDRRecord), 0) << c.name;
    }

    // Only the subsystem's ids are taken: its unused routine is answered, others left alone.
    STWKernReceivedRequest received = wellFormed(kEndMarkerOnly);
    received.request.header.id = STWKernUnusedRoutineID;
    STWKernReply reply{};
    EXPECT_FALSE(demux_server(&received.request.header, &reply.header));
    EXPECT_EQ(reply.error.returnCode, STWKernMIGBadID);
    EXPECT_EQ(reply.header.id, 322515001u);

    for (uint32_t id : {uint32_t{0}, STWKernSubsystemBase - 1, STWKernSubsystemBase + 2}) {
        received.request.header.id = id;
        STWKernReply untouched;
        memset(&untouched, 0xA5, sizeof untouched);
        STWKernReply before = untouched;
        EXPECT_FALSE(demux_server(&received.request.header, &untouched.header)) << id;
        EXPECT_EQ(memcmp(&untouched, &before, sizeof before), 0) << id;
    }
}

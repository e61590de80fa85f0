// The messages of the kernel upcall protocol, byte for byte as the kernel's sandbox sends
// and expects them (native byte order, 4-byte packing), with the tags of the packed
// buffers they carry.
//
// One routine, get-process-containers (message id 322514900): the request carries a
// packed buffer out of line that names a process's identifiers, groups, user and persona;
// the reply carries a packed buffer of paths out of line, or a 36-byte error reply with a
// return code. On this platform the messages travel over the upcall socket (see
// STWUpcallListener and STWKernTransport.h); the receiver's trailer with the sender's
// audit token is built from the socket peer's credentials.
//
// Used by the server (demux_server, server_get_process_containers), the transport and
// libstowly's STWUpcallClient.
#pragma once

#include "platform/STWAuditToken.h"

#include <cstddef>
#include <cstdint>

using STWKernReturn = int32_t;

inline constexpr uint32_t STWKernSubsystemBase = 322514900; // 0x13392FD4
inline constexpr uint32_t STWKernGetProcessContainersID = STWKernSubsystemBase;
// The second id of the subsystem's range: no routine behind it.
inline constexpr uint32_t STWKernUnusedRoutineID = STWKernSubsystemBase + 1;
inline constexpr uint32_t STWKernReplyIDOffset = 100;
// The largest message the server loop receives (the request without its trailer).
inline constexpr uint32_t STWKernMaxMessageSize = 56;

inline constexpr uint32_t STWKernMessageBitsComplex = 0x80000000u;
inline constexpr uint32_t STWKernMessageBitsRemoteMask = 0x1fu;
inline constexpr uint8_t STWKernDescriptorTypeOutOfLine = 1;
inline constexpr uint8_t STWKernCopyVirtual = 1;
inline constexpr uint32_t STWKernTrailerFormat0 = 0;
// The smallest trailer that holds the audit token's predecessors (type, size, sequence,
// security token): what the server needs at least.
inline constexpr uint32_t STWKernMinTrailerSize = 32;

// Return codes: the kernel's own for the routine, the message layer's negative ones for a
// message the server cannot take.
enum : STWKernReturn {
    STWKernSuccess = 0,
    STWKernInvalidArgument = 4,
    STWKernFailure = 5,
    STWKernResourceShortage = 6,
    STWKernMemoryFailure = 9,
    STWKernMIGTypeError = -300,
    STWKernMIGBadID = -303,
    STWKernMIGBadArguments = -304,
    STWKernMIGTrailerError = -309,
};

// Tags of the request buffer.
enum : uint16_t {
    STW_KERN_REQUEST_CODE_SIGNATURE_ID = 0,
    STW_KERN_REQUEST_CONTAINER_ID = 1,
    STW_KERN_REQUEST_APPLICATION_ID = 2,
    STW_KERN_REQUEST_UID = 3,
    STW_KERN_REQUEST_APP_GROUP_ID = 4,
    STW_KERN_REQUEST_CONTAINER_TYPE = 5,
    STW_KERN_REQUEST_SYSTEM_CONTAINER_ID = 6,
    STW_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID = 7,
    STW_KERN_REQUEST_PERSONA_ID = 8,
};

// Tags of the reply buffer, in the order they are packed.
enum : uint16_t {
    STW_KERN_REPLY_STATUS = 0,
    STW_KERN_REPLY_DATA_CONTAINER = 1,
    STW_KERN_REPLY_TEMP_DIRECTORY = 2,
    STW_KERN_REPLY_APP_GROUP_ID = 3,
    STW_KERN_REPLY_APP_GROUP_CONTAINER = 4,
    STW_KERN_REPLY_HOME_DIRECTORY = 100,
    STW_KERN_REPLY_SYSTEM_CONTAINER = 101,
    STW_KERN_REPLY_SYSTEM_GROUP_ID = 102,
    STW_KERN_REPLY_SYSTEM_GROUP_CONTAINER = 103,
};

// The sandbox's container type (STW_KERN_REQUEST_CONTAINER_TYPE).
inline constexpr uint32_t STWKernContainerTypeApplication = 0;
inline constexpr uint32_t STWKernContainerTypePlugin = 1;
inline constexpr uint32_t STWKernNoPersona = 0xFFFFFFFFu;

#pragma pack(push, 4)

struct STWKernHeader {
    uint32_t bits;
    uint32_t size;
    uint32_t remotePort; // in a request: the port the reply goes to
    uint32_t localPort;
    uint32_t voucherPort;
    uint32_t id;
};

struct STWKernOutOfLineDescriptor {
    uint64_t address;
    uint8_t deallocate;
    uint8_t copy;
    uint8_t pad;
    uint8_t type;
    uint32_t size;
};

struct STWKernNDR {
    uint8_t migVersion;
    uint8_t interfaceVersion;
    uint8_t reserved1;
    uint8_t migEncoding;
    uint8_t integerRepresentation;
    uint8_t characterRepresentation;
    uint8_t floatRepresentation;
    uint8_t reserved2;
};
// The data representation every message carries: little-endian integers, ASCII, IEEE floats.
inline constexpr STWKernNDR STWKernNDRRecord = {0, 0, 0, 0, 1, 0, 0, 0};

// The request, and the success reply, which has the same layout.
struct STWKernDataMessage {
    STWKernHeader header;
    uint32_t descriptorCount;
    STWKernOutOfLineDescriptor data;
    STWKernNDR ndr;
    uint32_t dataCount;
};
using STWKernRequest = STWKernDataMessage;
using STWKernSuccessReply = STWKernDataMessage;

struct STWKernTrailer {
    uint32_t type;
    uint32_t size;
    uint32_t sequence;
    uint32_t securityToken[2]; // euid, egid
    STWAuditToken auditToken;
};

// A request as the server loop receives it: the message and the receiver's trailer.
struct STWKernReceivedRequest {
    STWKernRequest request;
    STWKernTrailer trailer;
};

struct STWKernErrorReply {
    STWKernHeader header;
    STWKernNDR ndr;
    STWKernReturn returnCode;
};

// Room for any reply the server makes.
union STWKernReply {
    STWKernHeader header;
    STWKernErrorReply error;
    STWKernSuccessReply success;
};

#pragma pack(pop)

static_assert(sizeof(STWAuditToken) == 32);
static_assert(sizeof(STWKernHeader) == 24);
static_assert(offsetof(STWKernDataMessage, descriptorCount) == 24);
static_assert(offsetof(STWKernDataMessage, data) == 28);
static_assert(offsetof(STWKernDataMessage, data) + offsetof(STWKernOutOfLineDescriptor, type) == 39);
static_assert(offsetof(STWKernDataMessage, data) + offsetof(STWKernOutOfLineDescriptor, size) == 40);
static_assert(offsetof(STWKernDataMessage, ndr) == 44);
static_assert(offsetof(STWKernDataMessage, dataCount) == 52);
static_assert(sizeof(STWKernDataMessage) == STWKernMaxMessageSize);
static_assert(sizeof(STWKernTrailer) == 52);
static_assert(offsetof(STWKernReceivedRequest, trailer) + offsetof(STWKernTrailer, auditToken) == 76);
static_assert(offsetof(STWKernErrorReply, ndr) == 24);
static_assert(offsetof(STWKernErrorReply, returnCode) == 32);
static_assert(sizeof(STWKernErrorReply) == 36);

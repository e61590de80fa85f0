#include "upcall/STWKernProcessContainers.h"

#include "common/STWLog.h"
#include "src/packbuff/packbuff.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>

#define STW_ROUTINE_LOG(level, ...) \
    STW_LOG_FN("server_get_process_containers", level, STWLogCategory::Upcall, __VA_ARGS__)

namespace {

struct PackbuffFree {
    void operator()(sb_packbuff* pb) const { sb_packbuff_free(pb); }
};
using Packbuff = std::unique_ptr<sb_packbuff, PackbuffFree>;

const char* requestTagName(uint16_t tag) {
    switch (tag) {
    case STW_KERN_REQUEST_CODE_SIGNATURE_ID:
        return "STW_KERN_REQUEST_CODE_SIGNATURE_ID";
    case STW_KERN_REQUEST_CONTAINER_ID:
        return "STW_KERN_REQUEST_CONTAINER_ID";
    case STW_KERN_REQUEST_APPLICATION_ID:
        return "STW_KERN_REQUEST_APPLICATION_ID";
    case STW_KERN_REQUEST_UID:
        return "STW_KERN_REQUEST_UID";
    case STW_KERN_REQUEST_APP_GROUP_ID:
        return "STW_KERN_REQUEST_APP_GROUP_ID";
    case STW_KERN_REQUEST_CONTAINER_TYPE:
        return "STW_KERN_REQUEST_CONTAINER_TYPE";
    case STW_KERN_REQUEST_SYSTEM_CONTAINER_ID:
        return "STW_KERN_REQUEST_SYSTEM_CONTAINER_ID";
    case STW_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID:
        return "STW_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID";
    case STW_KERN_REQUEST_PERSONA_ID:
        return "STW_KERN_REQUEST_PERSONA_ID";
    }
    return "unknown";
}

// The string item at the cursor; false (logged) when the item is not one.
bool unpackString(sb_packbuff* pb, uint16_t tag, std::string* value) {
    int error = 0;
    size_t length = 0;
    const char* string = sb_packbuff_unpack_string(pb, &length, &error);
    if (error) {
        STW_ROUTINE_LOG(STWLogLevel::Error, "failed: to unpack string for %s. error: %d\n", requestTagName(tag), error);
        return false;
    }
    value->assign(string, length);
    return true;
}

bool unpackUInt32(sb_packbuff* pb, uint16_t tag, uint32_t* value) {
    int error = 0;
    uint32_t unpacked = sb_packbuff_unpack_uint32(pb, &error);
    if (error) {
        STW_ROUTINE_LOG(STWLogLevel::Error, "failed: to unpack uint32 for %s. error: %d\n", requestTagName(tag), error);
        return false;
    }
    *value = unpacked;
    return true;
}

bool packPath(sb_packbuff* pb, uint16_t tag, const std::optional<std::string>& path) {
    if (!path)
        return true;
    int error = sb_packbuff_pack_string(pb, tag, path->c_str(), path->size());
    if (error)
        STW_ROUTINE_LOG(STWLogLevel::Error, "sb_packbuff_pack_string() fails: %d; type: %u, path: %s\n", error, tag,
                        *path);
    return error == 0;
}

bool packPairs(sb_packbuff* pb, uint16_t keyTag, uint16_t valueTag,
               const std::vector<std::pair<std::string, std::string>>& pairs, const char* failure) {
    for (const auto& [identifier, path] : pairs) {
        int error = sb_packbuff_pack_key_with_string_value(pb, keyTag, identifier.c_str(), valueTag, path.c_str());
        if (error) {
            STW_ROUTINE_LOG(STWLogLevel::Error, failure, error, identifier, path);
            return false;
        }
    }
    return true;
}

} // namespace

STWKernReturn STWKernProcessContainersRequest::decode(const void* memory, uint32_t size,
                                                      STWKernProcessContainersRequest* request) {
    // Wrapped for reading only: the memory is the sender's and stays as it is.
    Packbuff pb(sb_packbuff_init_with_buffer(const_cast<void*>(memory), size, true, SB_PACKBUFF_DEALLOC_NONE));
    STW_ROUTINE_LOG(STWLogLevel::Debug, "request packbuff byte address:%p", memory);
    if (!pb) {
        STW_ROUTINE_LOG(STWLogLevel::Error, "sb_packbuff_init() of request data fails");
        return STWKernMemoryFailure;
    }
    uint16_t tag;
    while (sb_packbuff_get_item_value_type(pb.get(), &tag)) {
        // A failed item fails the whole request, so what it left in the request does not matter.
        bool read;
        switch (tag) {
        case STW_KERN_REQUEST_CODE_SIGNATURE_ID:
            read = unpackString(pb.get(), tag, &request->codeSignatureIdentifier.emplace());
            break;
        case STW_KERN_REQUEST_CONTAINER_ID:
            read = unpackString(pb.get(), tag, &request->containerIdentifier.emplace());
            break;
        case STW_KERN_REQUEST_APPLICATION_ID:
            read = unpackString(pb.get(), tag, &request->applicationIdentifier.emplace());
            break;
        case STW_KERN_REQUEST_SYSTEM_CONTAINER_ID:
            read = unpackString(pb.get(), tag, &request->systemContainerIdentifier.emplace());
            break;
        case STW_KERN_REQUEST_APP_GROUP_ID:
            read = unpackString(pb.get(), tag, &request->appGroupIdentifiers.emplace_back());
            break;
        case STW_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID:
            read = unpackString(pb.get(), tag, &request->systemGroupIdentifiers.emplace_back());
            break;
        case STW_KERN_REQUEST_UID:
            read = unpackUInt32(pb.get(), tag, &request->uid);
            break;
        case STW_KERN_REQUEST_CONTAINER_TYPE:
            read = unpackUInt32(pb.get(), tag, &request->containerType);
            break;
        case STW_KERN_REQUEST_PERSONA_ID:
            read = unpackUInt32(pb.get(), tag, &request->personaID);
            break;
        default:
            STW_ROUTINE_LOG(STWLogLevel::Error, "unexpected value: %u\n", tag);
            return STWKernInvalidArgument;
        }
        if (!read)
            return STWKernFailure;
    }
    return STWKernSuccess;
}

STWKernReturn STWKernProcessContainersReply::copyOut(void** memory, uint32_t* size, bool* deallocate) const {
    Packbuff pb(sb_packbuff_new(4096));
    if (!pb)
        return STWKernMemoryFailure;
    uint32_t packedStatus = status;
    if (packedStatus == 1)
        packedStatus = packPath(pb.get(), STW_KERN_REPLY_HOME_DIRECTORY, homeDirectory) &&
                               packPath(pb.get(), STW_KERN_REPLY_DATA_CONTAINER, dataContainer) &&
                               packPath(pb.get(), STW_KERN_REPLY_TEMP_DIRECTORY, tempDirectory) &&
                               packPairs(pb.get(), STW_KERN_REPLY_APP_GROUP_ID, STW_KERN_REPLY_APP_GROUP_CONTAINER,
                                         appGroups,
                                         "sb_packbuff_pack_key_with_string_value() fails: %d; group ID: %s, group "
                                         "container: %s\n") &&
                               packPath(pb.get(), STW_KERN_REPLY_SYSTEM_CONTAINER, systemContainer) &&
                               packPairs(pb.get(), STW_KERN_REPLY_SYSTEM_GROUP_ID,
                                         STW_KERN_REPLY_SYSTEM_GROUP_CONTAINER, systemGroups,
                                         "sb_packbuff_pack_key_with_string_value() fails: %d; group ID: %s, system "
                                         "group container: %s\n")
                           ? 1
                           : 0;
    if (int error = sb_packbuff_pack_uint32(pb.get(), STW_KERN_REPLY_STATUS, packedStatus))
        STW_ROUTINE_LOG(STWLogLevel::Error, "sb_packbuff_pack_uint32() fails: %d; type: %u, value: %u\n", error,
                        unsigned{STW_KERN_REPLY_STATUS}, packedStatus);

    // The reply travels in memory of its own, released once it is sent: the packed
    // buffer's own, taken from it rather than copied. Heap memory, not a mapping of its
    // own: unmapping one per upcall costs a TLB shoot-down on every core the daemon's
    // threads ran on, a tenth of an upcall's time.
    size_t used = sb_packbuff_get_size(pb.get());
    void* bytes = sb_packbuff_get_bytes(pb.get());
    void* reply = sb_packbuff_take_bytes(pb.get());
    if (!reply) {
        STW_ROUTINE_LOG(STWLogLevel::Error, "vm_read(%p, %lu) fails: %d", bytes, used, ENOMEM);
        return STWKernResourceShortage;
    }
    STW_ROUTINE_LOG(STWLogLevel::Debug, "packbuff bytes: %p, reply bytes: %p, reply size: %u", bytes, reply, used);
    *memory = reply;
    *size = static_cast<uint32_t>(used);
    *deallocate = true;
    return STWKernSuccess;
}

void STWKernReleaseReplyMemory(void* memory, uint32_t size) {
    (void)size;
    free(memory);
}

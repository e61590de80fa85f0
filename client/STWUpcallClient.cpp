#include "client/STWUpcallClient.h"

#include "src/packbuff/packbuff.h"

#include <cerrno>
#include <cstring>
#include <new>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>

namespace {

struct PackbuffFree {
    void operator()(sb_packbuff* pb) const { sb_packbuff_free(pb); }
};

std::optional<std::string> unpackString(sb_packbuff* pb) {
    int error = 0;
    size_t length = 0;
    const char* string = sb_packbuff_unpack_string(pb, &length, &error);
    if (error)
        return std::nullopt;
    return std::string(string, length);
}

// A key item followed by its value item with `valueTag`.
bool unpackPair(sb_packbuff* pb, uint16_t valueTag, std::vector<std::pair<std::string, std::string>>* pairs) {
    const char* key = nullptr;
    const char* value = nullptr;
    uint16_t tag = 0;
    size_t length = 0;
    if (sb_packbuff_unpack_key_with_string_value(pb, &key, &tag, &value, &length) != 0 || tag != valueTag)
        return false;
    pairs->emplace_back(key, std::string(value, length));
    return true;
}

STWErrorRef badReply(const char* what) { return STW_POSIX_ERROR_NOLOG(EBADMSG, "Bad upcall reply: %s", what); }

} // namespace

std::filesystem::path STWUpcallClient::socketPathForRoot(const std::filesystem::path& root) {
    return root / "run/stowly/upcall.sock";
}

std::unique_ptr<STWUpcallClient> STWUpcallClient::connect(const std::filesystem::path& socketPath,
                                                          STWErrorRef* error) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (socketPath.native().size() >= sizeof address.sun_path) {
        STWSetError(error, STW_POSIX_ERROR_NOLOG(ENAMETOOLONG, "Socket path %@ is too long", socketPath));
        return nullptr;
    }
    memcpy(address.sun_path, socketPath.c_str(), socketPath.native().size() + 1);
    STWFileDescriptor fd(socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    if (!fd || ::connect(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
        STWSetError(error, STW_POSIX_ERROR_NOLOG(errno, "Cannot connect to %@", socketPath));
        return nullptr;
    }
    // A packet must fit the send buffer whole: room for any request the daemon takes (a
    // request buffer of 1 MiB) and more, so that an oversized one reaches it and is refused there.
    int sendBuffer = 4 << 20;
    if (setsockopt(fd.get(), SOL_SOCKET, SO_SNDBUFFORCE, &sendBuffer, sizeof sendBuffer) != 0)
        setsockopt(fd.get(), SOL_SOCKET, SO_SNDBUF, &sendBuffer, sizeof sendBuffer);
    return std::unique_ptr<STWUpcallClient>(new STWUpcallClient(std::move(fd)));
}

std::string STWUpcallClient::packedBufferForRequest(const Request& request) {
    std::unique_ptr<sb_packbuff, PackbuffFree> pb(sb_packbuff_new(4096));
    if (!pb)
        throw std::bad_alloc();
    auto string = [&](uint16_t tag, const std::string& value) {
        sb_packbuff_pack_string(pb.get(), tag, value.c_str(), value.size());
    };
    auto uint32 = [&](uint16_t tag, std::optional<uint32_t> value) {
        if (value)
            sb_packbuff_pack_uint32(pb.get(), tag, *value);
    };
    if (request.codeSignatureIdentifier)
        string(STW_KERN_REQUEST_CODE_SIGNATURE_ID, *request.codeSignatureIdentifier);
    if (request.containerIdentifier)
        string(STW_KERN_REQUEST_CONTAINER_ID, *request.containerIdentifier);
    uint32(STW_KERN_REQUEST_UID, request.uid);
    for (const std::string& group : request.appGroupIdentifiers)
        string(STW_KERN_REQUEST_APP_GROUP_ID, group);
    uint32(STW_KERN_REQUEST_CONTAINER_TYPE, request.containerType);
    if (request.systemContainerIdentifier)
        string(STW_KERN_REQUEST_SYSTEM_CONTAINER_ID, *request.systemContainerIdentifier);
    for (const std::string& group : request.systemGroupIdentifiers)
        string(STW_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID, group);
    uint32(STW_KERN_REQUEST_PERSONA_ID, request.personaID);
    return std::string(static_cast<const char*>(sb_packbuff_get_bytes(pb.get())), sb_packbuff_get_size(pb.get()));
}

std::string STWUpcallClient::packetWithBuffer(std::string_view packedBuffer, uint32_t messageID) {
    STWKernRequest request{};
    // A copy-send right to the server and a send-once right for the reply, as the kernel sends.
    request.header = {.bits = STWKernMessageBitsComplex | 19 | (21 << 8),
                      .size = sizeof request,
                      .remotePort = 0,
                      .localPort = 0,
                      .voucherPort = 0,
                      .id = messageID};
    request.descriptorCount = 1;
    request.data = {.address = 0,
                    .deallocate = 0,
                    .copy = STWKernCopyVirtual,
                    .pad = 0,
                    .type = STWKernDescriptorTypeOutOfLine,
                    .size = static_cast<uint32_t>(packedBuffer.size())};
    request.ndr = STWKernNDRRecord;
    request.dataCount = static_cast<uint32_t>(packedBuffer.size());
    std::string packet(reinterpret_cast<const char*>(&request), sizeof request);
    packet.append(packedBuffer);
    return packet;
}

std::optional<STWUpcallClient::Reply> STWUpcallClient::replyFromPacket(std::string_view packet, STWErrorRef* error) {
    Reply reply;
    if (packet.size() == sizeof(STWKernErrorReply)) {
        STWKernErrorReply errorReply;
        memcpy(&errorReply, packet.data(), sizeof errorReply);
        reply.returnCode = errorReply.returnCode;
        if (reply.returnCode == STWKernSuccess) {
            STWSetError(error, badReply("an error reply without an error"));
            return std::nullopt;
        }
        return reply;
    }
    STWKernSuccessReply header;
    if (packet.size() < sizeof header) {
        STWSetError(error, badReply("too short"));
        return std::nullopt;
    }
    memcpy(&header, packet.data(), sizeof header);
    std::string buffer(packet.substr(sizeof header));
    if (!(header.header.bits & STWKernMessageBitsComplex) || header.dataCount != buffer.size() || buffer.empty()) {
        STWSetError(error, badReply("its size disagrees with its layout"));
        return std::nullopt;
    }
    std::unique_ptr<sb_packbuff, PackbuffFree> pb(
        sb_packbuff_init_with_buffer(buffer.data(), buffer.size(), true, SB_PACKBUFF_DEALLOC_NONE));
    uint16_t tag;
    bool sawStatus = false;
    while (pb && sb_packbuff_get_item_value_type(pb.get(), &tag)) {
        bool read = true;
        switch (tag) {
        case STW_KERN_REPLY_HOME_DIRECTORY:
            read = bool(reply.homeDirectory = unpackString(pb.get()));
            break;
        case STW_KERN_REPLY_DATA_CONTAINER:
            read = bool(reply.dataContainer = unpackString(pb.get()));
            break;
        case STW_KERN_REPLY_TEMP_DIRECTORY:
            read = bool(reply.tempDirectory = unpackString(pb.get()));
            break;
        case STW_KERN_REPLY_SYSTEM_CONTAINER:
            read = bool(reply.systemContainer = unpackString(pb.get()));
            break;
        case STW_KERN_REPLY_APP_GROUP_ID:
            read = unpackPair(pb.get(), STW_KERN_REPLY_APP_GROUP_CONTAINER, &reply.appGroups);
            break;
        case STW_KERN_REPLY_SYSTEM_GROUP_ID:
            read = unpackPair(pb.get(), STW_KERN_REPLY_SYSTEM_GROUP_CONTAINER, &reply.systemGroups);
            break;
        case STW_KERN_REPLY_STATUS: {
            int unpackError = 0;
            reply.status = sb_packbuff_unpack_uint32(pb.get(), &unpackError);
            read = sawStatus = unpackError == 0;
            break;
        }
        default:
            read = false;
        }
        if (!read) {
            STWSetError(error, badReply("an item it cannot read"));
            return std::nullopt;
        }
    }
    if (!sawStatus) {
        STWSetError(error, badReply("no status"));
        return std::nullopt;
    }
    return reply;
}

std::optional<std::string> STWUpcallClient::exchangePacket(std::string_view packet, std::chrono::milliseconds timeout,
                                                           STWErrorRef* error) {
    if (::send(_fd.get(), packet.data(), packet.size(), MSG_NOSIGNAL) != static_cast<ssize_t>(packet.size())) {
        STWSetError(error, STW_POSIX_ERROR_NOLOG(errno, "Cannot send an upcall of %zu bytes", packet.size()));
        return std::nullopt;
    }
    pollfd readable{.fd = _fd.get(), .events = POLLIN, .revents = 0};
    int ready = poll(&readable, 1, static_cast<int>(timeout.count()));
    if (ready <= 0) {
        STWSetError(error, STW_POSIX_ERROR_NOLOG(ready == 0 ? ETIMEDOUT : errno, "No upcall reply"));
        return std::nullopt;
    }
    // The reply's size first, so that any reply fits.
    ssize_t size = recv(_fd.get(), nullptr, 0, MSG_PEEK | MSG_TRUNC);
    std::string reply(size > 0 ? static_cast<size_t>(size) : 0, '\0');
    if (size <= 0 || recv(_fd.get(), reply.data(), reply.size(), 0) != size) {
        STWSetError(error, STW_POSIX_ERROR_NOLOG(size < 0 ? errno : ECONNRESET, "The upcall connection closed"));
        return std::nullopt;
    }
    return reply;
}

std::optional<STWUpcallClient::Reply> STWUpcallClient::send(const Request& request, std::chrono::milliseconds timeout,
                                                            STWErrorRef* error) {
    auto packet = exchangePacket(packetWithBuffer(packedBufferForRequest(request)), timeout, error);
    if (!packet)
        return std::nullopt;
    return replyFromPacket(*packet, error);
}

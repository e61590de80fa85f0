// Upcalls over the daemon's real upcall socket, sent as root, which stands for the kernel.
#include "tests/e2e/STWE2ETestSupport.h"

#include "client/STWUpcallClient.h"
#include "src/packbuff/packbuff.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cstring>
#include <sys/fsuid.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

using namespace STWE2E;

namespace {

using Request = STWUpcallClient::Request;
using Reply = STWUpcallClient::Reply;
using Pairs = std::vector<std::pair<std::string, std::string>>;

constexpr std::chrono::seconds kTimeout{30};

// The upcall socket appears a little after the request socket that STWDaemonProcess waits for.
std::unique_ptr<STWUpcallClient> connectUpcall(const STWDaemonProcess& daemon) {
    auto deadline = std::chrono::steady_clock::now() + STWDaemonProcess::timeout;
    STWErrorRef error;
    std::unique_ptr<STWUpcallClient> client;
    while (!(client = STWUpcallClient::connect(STWUpcallClient::socketPathForRoot(daemon.root()), &error)) &&
           std::chrono::steady_clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    EXPECT_NE(client, nullptr) << (error ? error->description() : "");
    return client;
}

// A request of the mobile user's personal persona; `identifier` names the process.
Request appRequest(const std::string& identifier) {
    Request request;
    request.codeSignatureIdentifier = identifier;
    request.uid = 501;
    request.containerType = STWKernContainerTypeApplication;
    request.personaID = STWKernNoPersona;
    return request;
}

// The return code of the reply to one packet on a fresh connection; nullopt when it closed.
std::optional<STWKernReturn> returnCode(const STWDaemonProcess& daemon, std::string_view packet) {
    auto client = connectUpcall(daemon);
    if (!client)
        return std::nullopt;
    STWErrorRef error;
    auto bytes = client->exchangePacket(packet, kTimeout, &error);
    if (!bytes) {
        EXPECT_EQ(error->code(), ECONNRESET) << error->description();
        return std::nullopt;
    }
    auto reply = STWUpcallClient::replyFromPacket(*bytes, &error);
    EXPECT_TRUE(reply) << error->description();
    return reply ? std::optional(reply->returnCode) : std::nullopt;
}

// The tags of a success reply packet, in the order they came.
std::vector<uint16_t> replyTags(std::string packet) {
    std::vector<uint16_t> tags;
    std::string buffer = packet.substr(sizeof(STWKernSuccessReply));
    sb_packbuff* pb = sb_packbuff_init_with_buffer(buffer.data(), buffer.size(), true, SB_PACKBUFF_DEALLOC_NONE);
    uint16_t tag;
    while (pb && sb_packbuff_get_item_value_type(pb, &tag) && sb_packbuff_skip_item(pb) == 0)
        tags.push_back(tag);
    sb_packbuff_free(pb);
    return tags;
}

// A request buffer with one item of each (tag, uint32 value) or (tag, string) pair.
std::string packedBuffer(const std::vector<std::pair<uint16_t, std::string>>& strings,
                         const std::vector<std::pair<uint16_t, uint32_t>>& values = {}) {
    sb_packbuff* pb = sb_packbuff_new(256);
    for (const auto& [tag, value] : strings)
        sb_packbuff_pack_string(pb, tag, value.c_str(), value.size());
    for (const auto& [tag, value] : values)
        sb_packbuff_pack_uint32(pb, tag, value);
    std::string bytes(static_cast<const char*>(sb_packbuff_get_bytes(pb)), sb_packbuff_get_size(pb));
    sb_packbuff_free(pb);
    return bytes;
}

class STWUpcallTest : public SharedDaemonTest {
protected:
    void SetUp() override {
        if (geteuid() != 0)
            GTEST_SKIP() << "the upcall socket is root's alone: run the tests as root";
        connect();
    }
    Reply upcall(const Request& request) {
        auto upcalls = connectUpcall(*daemon);
        STWErrorRef error;
        std::optional<Reply> reply = upcalls ? upcalls->send(request, kTimeout, &error) : std::nullopt;
        EXPECT_TRUE(reply) << (error ? error->description() : "");
        Reply none;
        none.returnCode = -1;
        return reply.value_or(none);
    }
    // The path command 0 answers for an existing container; "" when there is none.
    std::string lookedUp(const std::string& identifier, uint64_t containerClass) {
        return path(send(0, keys(identifier, containerClass, false)));
    }
};

} // namespace

// A launch is answered with every container it names, in reply order, as the request socket
// knows them; root has its own home, and a plug-in gets a plug-in data container.
TEST_F(STWUpcallTest, AnswersEveryContainerInReplyOrderAsTheRequestSocketKnowsThem) {
    Request request = appRequest("com.example.upcall.app");
    request.containerIdentifier = "com.example.upcall.data";
    request.appGroupIdentifiers = {"group.com.example.upcall.a", "group.com.example.upcall.b"};
    request.systemContainerIdentifier = "com.vorlane.upcall.system";
    request.systemGroupIdentifiers = {"systemgroup.com.vorlane.upcall"};

    auto client = connectUpcall(*daemon);
    ASSERT_NE(client, nullptr);
    STWErrorRef error;
    auto packet = client->exchangePacket(STWUpcallClient::packetWithBuffer(STWUpcallClient::packedBufferForRequest(request)),
                                         kTimeout, &error);
    ASSERT_TRUE(packet) << error->description();
    EXPECT_EQ(replyTags(*packet), (std::vector<uint16_t>{100, 1, 2, 3, 4, 3, 4, 101, 102, 103, 0}));
    auto reply = STWUpcallClient::replyFromPacket(*packet, &error);
    ASSERT_TRUE(reply) << error->description();
    EXPECT_EQ(reply->status, 1u);

    // The container id names the data container, not the signing id.
    EXPECT_EQ(lookedUp("com.example.upcall.app", 2), "");
    std::string data = lookedUp("com.example.upcall.data", 2);
    ASSERT_NE(data, "");
    EXPECT_EQ(reply->dataContainer, data);
    EXPECT_EQ(reply->tempDirectory, data + "/tmp");
    EXPECT_EQ(reply->homeDirectory, (daemon->root() / "private/var/mobile").native());
    EXPECT_EQ(reply->appGroups, (Pairs{{"group.com.example.upcall.a", lookedUp("group.com.example.upcall.a", 7)},
                                       {"group.com.example.upcall.b", lookedUp("group.com.example.upcall.b", 7)}}));
    EXPECT_EQ(reply->systemContainer, lookedUp("com.vorlane.upcall.system", 12));
    EXPECT_EQ(reply->systemGroups,
              (Pairs{{"systemgroup.com.vorlane.upcall", lookedUp("systemgroup.com.vorlane.upcall", 13)}}));

    // The next launch finds the same containers, on the same connection.
    auto again = client->send(request, kTimeout, &error);
    ASSERT_TRUE(again) << error->description();
    EXPECT_EQ(again->dataContainer, reply->dataContainer);
    EXPECT_EQ(again->appGroups, reply->appGroups);
    Request root = appRequest("com.example.upcall.root");
    root.uid = 0;
    EXPECT_EQ(upcall(root).homeDirectory, (daemon->root() / "private/var/root").native());

    // A plug-in's data container is class 4, also when the mapping recorded an app's class.
    auto recorded = codeSigningKeys("com.example.upcall.recorded", {});
    recorded["OptionsDictionary"] =
        STWValue(STWValue::Dictionary{{"com.vorlane.Stowly.DataContainerClass", STWValue(uint64_t{2})}});
    ASSERT_EQ(code(send(18, recorded)), STWErrorSuccess);
    for (const char* identifier : {"com.example.upcall.plugin", "com.example.upcall.recorded"}) {
        Request request = appRequest(identifier);
        request.containerType = STWKernContainerTypePlugin;
        Reply reply = upcall(request);
        ASSERT_EQ(reply.returnCode, STWKernSuccess) << identifier;
        ASSERT_EQ(reply.status, 1u) << identifier;
        EXPECT_EQ(reply.dataContainer, lookedUp(identifier, 4)) << identifier;
        EXPECT_EQ(lookedUp(identifier, 2), "") << identifier;
    }
}

// An unknown persona, and a sender that is not root, are refused and nothing is made.
TEST_F(STWUpcallTest, OnlyTheKernelAndKnownPersonasGetContainers) {
    std::string app = packedBuffer({{0, "com.example.upcall.refused"}}, {{8, STWKernNoPersona}});
    Request unknown = appRequest("com.example.upcall.persona");
    unknown.personaID = 4242;
    EXPECT_EQ(upcall(unknown).returnCode, STWKernInvalidArgument);
    EXPECT_EQ(lookedUp("com.example.upcall.persona", 2), "") << "nothing is made for an unknown persona";

    // A sender that is not root (by its effective uid; its file-system uid stays root's) is no kernel.
    std::string packet = STWUpcallClient::packetWithBuffer(app);
    std::string socketPath = STWUpcallClient::socketPathForRoot(daemon->root());
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        memcpy(address.sun_path, socketPath.c_str(), socketPath.size() + 1);
        if (setresuid(0, 501, 0) != 0)
            _exit(100);
        setfsuid(0);
        int fd = socket(AF_UNIX, SOCK_SEQPACKET, 0);
        if (::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
            ::send(fd, packet.data(), packet.size(), 0) != static_cast<ssize_t>(packet.size()))
            _exit(101);
        STWKernErrorReply reply{};
        if (recv(fd, &reply, sizeof reply, 0) != sizeof reply)
            _exit(102);
        _exit(reply.returnCode == STWKernFailure ? 0 : 103);
    }
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "child status " << status;
    EXPECT_EQ(lookedUp("com.example.upcall.refused", 2), "");
}

// Malformed and hostile packets get their codes or a closed connection; the server goes on.
TEST_F(STWUpcallTest, HostilePacketsGetTheirCodesAndNeverStopTheServer) {
    std::string refused = packedBuffer({{0, "com.example.upcall.refused"}}, {{8, STWKernNoPersona}});
    std::string good = STWUpcallClient::packetWithBuffer(packedBuffer({{0, "com.example.upcall.hostile"}}, {{8, STWKernNoPersona}}));
    auto withDataCount = [&](uint32_t count) {
        std::string p = good;
        memcpy(p.data() + offsetof(STWKernRequest, dataCount), &count, sizeof count);
        return p;
    };
    std::string noEndMarker = packedBuffer({{0, "com.example.upcall.hostile"}});
    noEndMarker.resize(noEndMarker.size() - 8);
    std::string pastTheEnd = packedBuffer({{0, "com.example.upcall.hostile"}});
    pastTheEnd[4] = 100; // the string's length runs past the buffer
    struct Case {
        const char* name;
        std::string packet;
        std::optional<STWKernReturn> code; // nullopt: the connection closes
    };
    std::vector<Case> cases = {
        {"an item the routine does not know", STWUpcallClient::packetWithBuffer(packedBuffer({{0, "x"}}, {{9, 1}})),
         STWKernInvalidArgument},
        {"a uid sent as a string", STWUpcallClient::packetWithBuffer(packedBuffer({{3, "501"}})), STWKernFailure},
        {"the unused routine id", STWUpcallClient::packetWithBuffer(refused, STWKernUnusedRoutineID), STWKernMIGBadID},
        // No routine answers another id: the connection closes rather than leave the sender waiting.
        {"another routine id", STWUpcallClient::packetWithBuffer(refused, 7), std::nullopt},
        {"shorter than a header", good.substr(0, 10), std::nullopt},
        {"shorter than the layout", good.substr(0, 40), STWKernMIGBadArguments},
        {"a data count that lies", withDataCount(8), STWKernMIGTypeError},
        {"no end marker", STWUpcallClient::packetWithBuffer(noEndMarker), STWKernFailure},
        {"a string past the end", STWUpcallClient::packetWithBuffer(pastTheEnd), STWKernFailure},
        {"an empty buffer", STWUpcallClient::packetWithBuffer(""), STWKernMemoryFailure},
        {"over the size bound", STWUpcallClient::packetWithBuffer(std::string(2 << 20, '\0')), std::nullopt},
    };
    for (const Case& c : cases)
        EXPECT_EQ(returnCode(*daemon, c.packet), c.code) << c.name;
    EXPECT_EQ(lookedUp("com.example.upcall.refused", 2), "");

    // A 16 MiB packet: refused by the sender's socket, or the daemon closes the connection.
    if (auto client = connectUpcall(*daemon)) {
        int size = 32 << 20;
        setsockopt(client->fd(), SOL_SOCKET, SO_SNDBUFFORCE, &size, sizeof size);
        STWErrorRef error;
        EXPECT_FALSE(client->exchangePacket(STWUpcallClient::packetWithBuffer(std::string(16 << 20, 'x')), kTimeout,
                                            &error));
    }
    // A sender that leaves before its reply.
    if (auto client = connectUpcall(*daemon)) {
        EXPECT_EQ(::send(client->fd(), good.data(), good.size(), 0), static_cast<ssize_t>(good.size()));
    }

    // 10,000 times the same group: one container, named 10,000 times.
    Request repeated = appRequest("com.example.upcall.repeated");
    repeated.appGroupIdentifiers.assign(10000, "group.com.example.upcall.repeated");
    Reply many = upcall(repeated);
    EXPECT_EQ(many.status, 1u);
    ASSERT_EQ(many.appGroups.size(), 10000u);
    EXPECT_EQ(many.appGroups.back().second, lookedUp("group.com.example.upcall.repeated", 7));

    EXPECT_EQ(upcall(appRequest("com.example.upcall.after")).status, 1u);
    EXPECT_TRUE(daemon->isRunning());
}

// A group that cannot be made leaves a reply of status 0 (the other groups made); a stop waits
// for the upcall being served (parked behind a test lock, which SIGTERM releases).
TEST(STWUpcallFailureTest, AFailedGroupAndAStopInFlightStillAnswerTheSender) {
    if (geteuid() != 0)
        GTEST_SKIP() << "the upcall socket is root's alone: run the tests as root";
    STWDaemonProcess daemon(internal, {}, false);
    // The first rename after start-up is the one that would publish the first group.
    ASSERT_TRUE(daemon.startWith("STOWLY_FAULT", "renameat2:1:28"));
    Request request;
    request.uid = 501;
    request.personaID = STWKernNoPersona;
    request.appGroupIdentifiers = {"group.com.example.upcall.first", "group.com.example.upcall.second"};
    auto client = connectUpcall(daemon);
    ASSERT_NE(client, nullptr);
    STWErrorRef error;
    auto packet = client->exchangePacket(
        STWUpcallClient::packetWithBuffer(STWUpcallClient::packedBufferForRequest(request)), kTimeout, &error);
    ASSERT_TRUE(packet) << error->description();
    EXPECT_EQ(replyTags(*packet), std::vector<uint16_t>{0});
    auto reply = STWUpcallClient::replyFromPacket(*packet, &error);
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->status, 0u);
    auto installer = daemon.connectAs("com.example.installer", allowed);
    ASSERT_NE(installer, nullptr);
    EXPECT_EQ(STWDaemonProcess::replyError(*installer, 0, keys("group.com.example.upcall.first", 7, false)),
              STWErrorNotFound);
    EXPECT_EQ(STWDaemonProcess::replyError(*installer, 0, keys("group.com.example.upcall.second", 7, false)),
              STWErrorSuccess);

    auto control = daemon.connectAs("com.example.tester", tester);
    ASSERT_NE(control, nullptr);
    ASSERT_EQ(setTestLock(*control, 1, true), STWErrorSuccess);
    std::atomic<bool> answered{false};
    std::thread launch([&] {
        reply = client->send(appRequest("com.example.upcall.parked"), kTimeout, &error);
        answered = true;
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    EXPECT_FALSE(answered) << "the upcall did not wait for the lock";
    EXPECT_TRUE(daemon.stop());
    launch.join();
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->status, 1u);
}

#include "Daemon/Model/STWUserIdentityCache.h"
#include "Daemon/Request/STWClientIdentity.h"
#include "platform/STWPeerConnection.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <csignal>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

namespace {

// A child process connected to a socket of ours, alive until the object goes away: a
// peer with an audit token of its own.
class ConnectedChild {
public:
    explicit ConnectedChild(const std::filesystem::path& socketPath, int listenFD) {
        _pid = fork();
        if (_pid == 0) {
            int fd = socket(AF_UNIX, SOCK_STREAM, 0);
            sockaddr_un address{};
            address.sun_family = AF_UNIX;
            strcpy(address.sun_path, socketPath.c_str());
            if (connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0)
                _exit(1);
            pause();
            _exit(0);
        }
        int fd = accept(listenFD, nullptr, nullptr);
        peer = STWPeerConnection::adopt(fd, nullptr);
    }
    ~ConnectedChild() {
        kill(_pid, SIGKILL);
        waitpid(_pid, nullptr, 0);
    }
    std::shared_ptr<STWPeerConnection> peer;

private:
    pid_t _pid;
};

class STWClientIdentityTest : public ::testing::Test {
protected:
    void SetUp() override {
        STWTestRoot::shared();
        STWClientIdentity::resetInstallerCacheForTesting();
        socketPath = STWTestRoot::shared().path() / "identity-test.sock";
        unlink(socketPath.c_str());
        listenFD = socket(AF_UNIX, SOCK_STREAM, 0);
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        strcpy(address.sun_path, socketPath.c_str());
        ASSERT_EQ(bind(listenFD, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
        ASSERT_EQ(listen(listenFD, 8), 0);
    }
    void TearDown() override { close(listenFD); }

    static void declare(STWPeerConnection& peer, const char* identifier, STWValue entitlements) {
        STWClientRegistryEntry entry;
        entry.codeSigningIdentifier = identifier;
        entry.entitlements = std::move(entitlements);
        peer.setDeclaredIdentity(std::make_shared<const STWClientRegistryEntry>(entry));
    }

    std::filesystem::path socketPath;
    int listenFD = -1;
};

} // namespace

TEST_F(STWClientIdentityTest, BooleanEntitlementsAndAPeersIdentity) {
    auto identity = STWClientIdentity::initWithBundleIdentifier(
        "com.example", 501, 501, 1, STWUserIdentityCache::defaultUserIdentity(),
        STWValue::Dictionary{{"bool", STWValue(true)},
                             {"one", STWValue(1)},
                             {"zero", STWValue(0)},
                             {"real", STWValue(0.5)},
                             {"string", STWValue("true")},
                             {"yes", STWValue("YES")},
                             {"array", STWValue(STWValue::Array{STWValue(true)})},
                             {"dict", STWValue(STWValue::Dictionary{{"a", STWValue(true)}})}},
        false, STWAuditToken{});
    for (const char* key : {"bool", "one", "real"})
        EXPECT_TRUE(identity->boolValueOfEntitlement(key)) << key;
    for (const char* key : {"zero", "string", "yes", "array", "dict", "absent"})
        EXPECT_FALSE(identity->boolValueOfEntitlement(key)) << key;
    // The daemon's own identity has no entitlements to read.
    EXPECT_FALSE(STWClientIdentity::anonymousPrivilegedClientIdentity()->boolValueOfEntitlement("bool"));

    // A peer's identity carries its credentials and survives malformed entitlements.
    ConnectedChild child(socketPath, listenFD);
    ASSERT_NE(child.peer, nullptr);
    declare(*child.peer, "com.example.peer", STWValue("not a dictionary"));
    auto peer = STWClientIdentity::clientIdentityWithTolvanConnection(*child.peer);
    ASSERT_NE(peer, nullptr);
    EXPECT_EQ(peer->posixPID(), child.peer->pid());
    EXPECT_EQ(peer->auditToken().pid(), child.peer->pid());
    ASSERT_TRUE(peer->entitlements().has_value());
    EXPECT_TRUE(peer->entitlements()->empty());

    // No signing identifier: no identity.
    child.peer->setDeclaredIdentity(nullptr);
    EXPECT_EQ(STWClientIdentity::clientIdentityWithTolvanConnection(*child.peer), nullptr);
}

TEST_F(STWClientIdentityTest, InstallerIdentityIsReusedOnlyForTheSameAuditToken) {
    STWValue entitlements(STWValue::Dictionary{{"com.vorlane.private.Stowly.allowed", STWValue(true)}});
    ConnectedChild first(socketPath, listenFD), second(socketPath, listenFD);
    ASSERT_TRUE(first.peer && second.peer);
    ASSERT_NE(first.peer->auditToken(), second.peer->auditToken());
    declare(*first.peer, STWInstallerBundleIdentifier, entitlements);
    declare(*second.peer, STWInstallerBundleIdentifier, entitlements);

    auto a1 = STWClientIdentity::clientIdentityWithTolvanConnection(*first.peer);
    ASSERT_NE(a1, nullptr);
    EXPECT_EQ(STWClientIdentity::clientIdentityWithTolvanConnection(*first.peer), a1); // no second copy

    auto b = STWClientIdentity::clientIdentityWithTolvanConnection(*second.peer);
    ASSERT_NE(b, nullptr);
    EXPECT_NE(b, a1);
    EXPECT_EQ(b->posixPID(), second.peer->pid());
    // The slot now holds the second installer; the first one is described afresh.
    auto a3 = STWClientIdentity::clientIdentityWithTolvanConnection(*first.peer);
    EXPECT_NE(a3, a1);
    EXPECT_EQ(a3->posixPID(), first.peer->pid());

    // Other callers are never cached.
    declare(*second.peer, "com.example.other", entitlements);
    EXPECT_NE(STWClientIdentity::clientIdentityWithTolvanConnection(*second.peer),
              STWClientIdentity::clientIdentityWithTolvanConnection(*second.peer));
}

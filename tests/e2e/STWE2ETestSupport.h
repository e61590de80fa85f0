// What the end-to-end tests share: the usual entitlements and settings, the keys of
// command 0, the fields of a reply, and the places below a daemon's root they look at.
#pragma once

#include "tests/support/STWDaemonProcess.h"
#include "tests/support/STWTestRoot.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWError.h"
#include "common/STWFileIO.h"
#include "platform/STWAuditToken.h"
#include "platform/STWSandboxExtension.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <set>
#include <string>
#include <unistd.h>
#include <vector>

namespace STWE2E {

namespace fs = std::filesystem;

inline const STWValue::Dictionary allowed{{"com.vorlane.private.Stowly.allowed", STWValue(true)}};
inline const STWValue::Dictionary tester{{"com.vorlane.private.Stowly.testability", STWValue(true)}};
inline const STWValue::Dictionary developer{{"DeveloperMode", STWValue(true)}};
inline const STWValue::Dictionary internal{{"DeveloperMode", STWValue(true)}, {"InternalImage", STWValue(true)}};

// The keys of command 0 (create or look up).
inline STWValue::Dictionary keys(const std::string& identifier, uint64_t containerClass = 2, bool create = true,
                                 bool transient = false) {
    return {{"Identifier", STWValue(identifier)},
            {"ContainerClass", STWValue(containerClass)},
            {"CreateIfNecessary", STWValue(create)},
            {"Transient", STWValue(transient)}};
}

inline uint64_t code(const STWValue::Dictionary& reply) {
    return STWDictionaryUInt64(reply, "ReplyError").value_or(0);
}
inline fs::path path(const STWValue::Dictionary& reply) {
    const std::string* p = STWDictionaryString(reply, "ReplyPath");
    return p ? fs::path(*p) : fs::path();
}
inline STWUUID uuid(const STWValue::Dictionary& reply) {
    const STWValue* v = STWDictionaryFind(reply, "ReplyUUID");
    return v && v->uuid() ? *v->uuid() : STWUUID{};
}

// The keys of command 18: `identifier`'s code-signing info, with `entitlements`.
inline STWValue::Dictionary codeSigningKeys(const std::string& identifier, const STWValue::Dictionary& entitlements) {
    return {{"Identifier", STWValue(identifier)},
            {"CodeSigningInfo",
             STWValue(STWValue::Dictionary{{"com.vorlane.Stowly.Entitlements", STWValue(entitlements)}})}};
}

// Command 31 of an internal build: holds or releases test lock `lock`.
inline uint64_t setTestLock(STWClient& control, int lock, bool enable) {
    return STWDaemonProcess::replyError(control, 31, {{"TestLock", STWValue(lock)}, {"Enable", STWValue(enable)}});
}

// Command 2 (replace) of the class 2 containers two replies name (no `oldReply`: a promotion).
inline STWValue::Dictionary replaceKeys(const std::string& identifier, const STWValue::Dictionary& oldReply,
                                        const STWValue::Dictionary& newReply) {
    STWValue::Dictionary k{{"NewIdentifier", STWValue(identifier)},
                           {"NewContainerClass", STWValue(2)},
                           {"NewContainerUUID", STWValue(uuid(newReply))}};
    if (!oldReply.empty()) {
        k["OldIdentifier"] = STWValue(identifier);
        k["OldContainerClass"] = STWValue(2);
        k["OldContainerUUID"] = STWValue(uuid(oldReply));
    }
    return k;
}

// The containers of a class directory whose metadata names `identifier`.
inline std::vector<fs::path> containersOf(const fs::path& classDirectory, const std::string& identifier) {
    std::vector<fs::path> found;
    std::error_code ec;
    for (fs::directory_iterator it(classDirectory, ec), end; !ec && it != end; it.increment(ec)) {
        auto metadata = STW_dictionaryWithContentsOfURL(it->path() / ".com.vorlane.stowly.metadata.plist", 0, nullptr);
        const std::string* name = metadata ? STWDictionaryString(*metadata, "STWMetadataIdentifier") : nullptr;
        if (name && *name == identifier)
            found.push_back(it->path());
    }
    return found;
}

// The little-endian length that begins every frame on the request socket.
inline std::string frameHeader(uint32_t length) {
    return {char(length), char(length >> 8), char(length >> 16), char(length >> 24)};
}

// Every name in a directory, dot names included (none when it does not exist).
inline std::set<std::string> names(const fs::path& directory) {
    std::set<std::string> found;
    std::error_code ec;
    for (fs::directory_iterator it(directory, ec), end; !ec && it != end; it.increment(ec))
        found.insert(it->path().filename());
    return found;
}
// How many names in a directory do not begin with a dot.
inline size_t visible(const fs::path& directory) {
    size_t n = 0;
    for (const auto& name : names(directory))
        n += name[0] != '.';
    return n;
}

inline void write(const fs::path& file, const std::string& text) {
    fs::create_directories(file.parent_path());
    std::ofstream(file) << text;
}
inline std::string read(const fs::path& file) {
    std::string text;
    return STWReadFileContents(file, &text, 0) == 0 ? text : std::string("<missing>");
}

// Whether `token` is a sandbox extension of `extensionClass` for `path` usable by this process.
inline bool tokenVerifies(const STWDaemonProcess& daemon, const std::string* token, std::string_view extensionClass,
                          const std::string& path) {
    std::string key;
    auto auditToken = STWAuditToken::forProcess(getpid(), geteuid(), getegid());
    return token && auditToken && STWReadFileContents(daemon.root() / "run/stowly/extension.key", &key) == 0 &&
           STWSandboxExtension::verify(*token, extensionClass, path, *auditToken, key);
}

struct Layout {
    fs::path root;
    fs::path live() const { return root / "private/var/mobile/Containers/Data/Application"; }
    fs::path userStaging() const { return root / "private/var/mobile/Containers/Staging"; }
    fs::path system() const { return root / "private/var/containers/Data/System"; }
    fs::path caches() const { return root / "private/var/root/Library/Caches/com.vorlane.stowlyd"; }
    fs::path deathRow() const { return caches() / "Dead"; }
    fs::path library() const { return root / "private/var/root/Library/Stowly"; }
    fs::path journals() const { return library() / "Replace"; }
    fs::path pendingUpdates() const { return library() / "PendingUpdates"; }
    fs::path backup() const { return root / "private/var/mobile/Library/Backup/SystemContainers"; }
};

// One daemon per test suite (developer mode, the personal persona PERSONAL-1 and the
// enterprise persona ENTERPRISE-1 of com.example.work), and an installer's connection per test.
class SharedDaemonTest : public ::testing::Test {
protected:
    static void SetUpTestSuite() {
        daemon = new STWDaemonProcess(developer, {STWTestRoot::persona("PERSONAL-1", 1000, "personal"),
                                                  STWTestRoot::persona("ENTERPRISE-1", 1001, "enterprise",
                                                                       {STWValue("com.example.work")})});
    }
    static void TearDownTestSuite() {
        delete daemon;
        daemon = nullptr;
    }
    void SetUp() override { connect(); }
    void connect() { ASSERT_NE(client = daemon->connectAs("com.example.installer", allowed), nullptr); }
    STWValue::Dictionary send(uint64_t command, STWValue::Dictionary k = {}) {
        return STWDaemonProcess::send(*client, command, std::move(k));
    }

    inline static STWDaemonProcess* daemon = nullptr;
    std::unique_ptr<STWClient> client;
};

} // namespace STWE2E

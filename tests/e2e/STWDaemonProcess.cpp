#include "tests/e2e/STWDaemonProcess.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWPropertyList.h"
#include "platform/STWPlatformConfiguration.h"

#include <gtest/gtest.h>

#include <csignal>
#include <fstream>
#include <semaphore.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

STWDaemonProcess::STWDaemonProcess(STWValue::Dictionary settings, STWValue::Array personas) {
    char templ[] = "/tmp/stowly-e2e-XXXXXX";
    if (!mkdtemp(templ))
        abort();
    _root = templ;
    std::filesystem::permissions(_root, std::filesystem::perms(0755));
    std::filesystem::create_directories(_root / "etc/stowly");
    std::ofstream(_root / "etc/passwd") << "root:x:0:0:root:/private/var/root:/bin/sh\n"
                                           "mobile:x:501:501:Mobile:/private/var/mobile:/bin/sh\n";
    std::ofstream(_root / "etc/group") << "root:x:0:\nmobile:x:501:\nsystemusers:x:950:mobile\n";
    if (!STW_writeToURL(settings, _root / "etc/stowly/stowlyd.plist", STWWriteAtomic, nullptr))
        abort();
    if (!personas.empty() && STWWriteFileAtomically(_root / "etc/stowly/personas.plist",
                                                    STWPropertyList::serializeBinary(STWValue(personas)), 0644,
                                                    false) != 0)
        abort();

    _pid = fork();
    if (_pid == 0) {
        execl(STOWLYD_PATH, "stowlyd", "--root", _root.c_str(), "--idle-timeout", "0", nullptr);
        _exit(127);
    }
    auto deadline = std::chrono::steady_clock::now() + timeout;
    while (std::chrono::steady_clock::now() < deadline && isRunning()) {
        if (STWClient::connect(socketPath(), nullptr))
            return;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    ADD_FAILURE() << "stowlyd did not start on " << _root;
}

STWDaemonProcess::~STWDaemonProcess() {
    if (_pid > 0) {
        kill(_pid, SIGTERM);
        int status = 0;
        waitpid(_pid, &status, 0);
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "stowlyd ended with status " << status;
    }
    // The first-boot marker lives outside the root; a daemon of another root never shares it.
    sem_unlink(STWPlatformConfiguration(_root).firstBootSemaphoreName().c_str());
    std::error_code ec;
    std::filesystem::remove_all(_root, ec);
}

bool STWDaemonProcess::isRunning() { return _pid > 0 && waitpid(_pid, nullptr, WNOHANG) == 0; }

std::unique_ptr<STWClient> STWDaemonProcess::connect() {
    STWErrorRef error;
    auto client = STWClient::connect(socketPath(), &error);
    EXPECT_NE(client, nullptr) << (error ? error->description() : "");
    return client;
}

std::unique_ptr<STWClient> STWDaemonProcess::connectAs(const std::string& identifier,
                                                      STWValue::Dictionary entitlements, bool sandboxed,
                                                      std::optional<std::string> persona) {
    auto client = connect();
    if (!client)
        return nullptr;
    STWErrorRef error;
    STWValue::Dictionary hello{{"CodeSigningIdentifier", STWValue(identifier)},
                               {"Entitlements", STWValue(std::move(entitlements))},
                               {"Sandboxed", STWValue(sandboxed)}};
    if (persona)
        hello["PersonaUniqueString"] = STWValue(*persona);
    auto code = client->hello(hello, timeout, &error);
    EXPECT_EQ(code.value_or(0), STWErrorSuccess);
    return client;
}

STWValue::Dictionary STWDaemonProcess::send(STWClient& client, uint64_t command, STWValue::Dictionary keys) {
    keys["Command"] = STWValue(command);
    STWErrorRef error;
    auto reply = client.sendMessage(keys, timeout, &error);
    return reply ? *reply : STWValue::Dictionary{};
}

uint64_t STWDaemonProcess::replyError(STWClient& client, uint64_t command, STWValue::Dictionary keys) {
    return STWDictionaryUInt64(send(client, command, std::move(keys)), "ReplyError").value_or(0);
}

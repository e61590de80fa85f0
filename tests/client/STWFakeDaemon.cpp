#include "tests/client/STWFakeDaemon.h"

#include "client/STWClient.h"

#include <gtest/gtest.h>

#include <cstring>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

STWFakeDaemon::STWFakeDaemon() {
    char templ[] = "/tmp/stowly-client-XXXXXX";
    if (!mkdtemp(templ))
        throw std::runtime_error("mkdtemp failed");
    _root = templ;
    std::filesystem::create_directories(_root / "run/stowly");

    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::string path = socketPath();
    strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    _listener = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (_listener < 0 || bind(_listener, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
        listen(_listener, 16) != 0)
        throw std::runtime_error(std::string("cannot listen: ") + strerror(errno));
}

STWFakeDaemon::~STWFakeDaemon() {
    // A script still waiting for a connection that never came fails instead of hanging.
    if (_listener >= 0)
        shutdown(_listener, SHUT_RDWR);
    join();
    stopListening();
    std::filesystem::remove_all(_root);
}

std::filesystem::path STWFakeDaemon::socketPath() const {
    return STWClient::socketPathForRoot(_root);
}

void STWFakeDaemon::serve(std::function<void(int fd)> script) {
    _threads.emplace_back([this, script = std::move(script)] {
        int fd = accept4(_listener, nullptr, nullptr, SOCK_CLOEXEC);
        if (fd < 0) {
            ADD_FAILURE() << "accept: " << strerror(errno);
            return;
        }
        script(fd);
        close(fd);
    });
}

void STWFakeDaemon::join() {
    for (std::thread& t : _threads)
        t.join();
    _threads.clear();
}

void STWFakeDaemon::stopListening() {
    if (_listener >= 0)
        close(_listener);
    _listener = -1;
}

std::optional<STWFrame> STWFakeDaemon::readFrame(STWFrameReader& reader) {
    STWFrame frame;
    std::string reason;
    STWFrameReadResult result = reader.read(frame, &reason);
    if (result != STWFrameReadResult::Frame) {
        ADD_FAILURE() << "expected a frame from the client: " << reason;
        return std::nullopt;
    }
    return frame;
}

void STWFakeDaemon::reply(int fd, uint64_t id, const STWValue::Dictionary& body) {
    EXPECT_TRUE(STWFrameWrite(fd, STWFrameEncode(STWFrameKindReply, id, body))) << strerror(errno);
}

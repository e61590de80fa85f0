// stowlyd's socket under a private root, each connection handed to a script of the test that
// speaks raw frames, so it can answer out of order, late, never or wrongly.
#pragma once

#include "common/STWIPCFrame.h"

#include <filesystem>
#include <functional>
#include <optional>
#include <thread>
#include <vector>

class STWFakeDaemon {
public:
    STWFakeDaemon();
    ~STWFakeDaemon(); // stops accepting, waits for the scripts, then removes the root

    const std::filesystem::path& root() const { return _root; }
    std::filesystem::path socketPath() const;

    // Runs `script` on a thread with the next accepted connection, then closes it.
    void serve(std::function<void(int fd)> script);
    // Waits for every script to finish.
    void join();
    // Stops accepting: later connects are refused.
    void stopListening();

    // Helpers for scripts. readFrame fails the test on anything but a frame.
    static std::optional<STWFrame> readFrame(STWFrameReader& reader);
    static void reply(int fd, uint64_t id, const STWValue::Dictionary& body);

private:
    std::filesystem::path _root;
    int _listener = -1;
    std::vector<std::thread> _threads;
};

// Values in failure messages as their description.
inline void PrintTo(const STWValue& value, std::ostream* os) {
    *os << value.description();
}

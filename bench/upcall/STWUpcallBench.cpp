// The upcall on the hot path of an application launch, against the request socket doing the
// same work, both measured in the same run on one daemon:
//
//   upcall_existing_app_and_group  an upcall for an app whose data container and one group
//       exist, against command 0 looking up the same two containers (two requests on one
//       connection), back to back; ratio = upcall time / look-ups time, goal <= 1.0: one
//       upcall does the work of the two look-ups it saves a launch.
//   upcall_first_launch  the first upcall for a new app and a new group (both containers
//       made), against command 0 creating the same two containers for another new app;
//       ratio = upcall time / creation time, goal <= 1.2.
//
// Latencies are per upcall and per pair of requests (p50, p99). The daemon runs with its
// default settings plus developer mode on a private root in /tmp, its system log in a file.
// The upcall socket is root's alone, so the benchmark needs root. Usage:
// stowly_bench_upcall [--quick]
#include "client/STWUpcallClient.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWLog.h"
#include "tests/support/STWDaemonProcess.h"

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <functional>
#include <stdexcept>
#include <thread>
#include <unistd.h>
#include <vector>

namespace {

using Clock = std::chrono::steady_clock;
constexpr std::chrono::seconds kTimeout{60};
const STWValue::Dictionary kAllowed{{"com.vorlane.private.Stowly.allowed", STWValue(true)}};

[[noreturn]] void die(const std::string& message) { throw std::runtime_error(message); }

double percentile(std::vector<double> values, double p) {
    std::sort(values.begin(), values.end());
    return values[std::min(values.size() - 1, static_cast<size_t>(p * static_cast<double>(values.size())))];
}

double mean(const std::vector<double>& values) {
    double sum = 0;
    for (double v : values)
        sum += v;
    return sum / static_cast<double>(values.size());
}

// Microseconds each of `count` calls of `work(i)` took.
std::vector<double> timed(size_t count, const std::function<void(size_t)>& work) {
    std::vector<double> micros;
    micros.reserve(count);
    for (size_t i = 0; i < count; i++) {
        auto start = Clock::now();
        work(i);
        micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
    }
    return micros;
}

class UpcallBench {
public:
    explicit UpcallBench(bool quick) : _quick(quick), _daemon({{"DeveloperMode", STWValue(true)}}, {}, false) {
        _daemon.setStandardErrorFile(_daemon.root() / "stowlyd.log");
        if (!_daemon.start())
            die("stowlyd did not start");
        _client = _daemon.connectAs("com.example.bench", kAllowed);
        if (!_client)
            die("cannot connect to the request socket");
        auto deadline = Clock::now() + kTimeout;
        STWErrorRef error;
        while (!(_upcall = STWUpcallClient::connect(STWUpcallClient::socketPathForRoot(_daemon.root()), &error)) &&
               Clock::now() < deadline)
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        if (!_upcall)
            die("cannot connect to the upcall socket: " + error->description());
    }

    void run() {
        _existingApp();
        _firstLaunch();
    }

private:
    static STWUpcallClient::Request _request(const std::string& app, const std::string& group) {
        STWUpcallClient::Request request;
        request.codeSignatureIdentifier = app;
        request.uid = 501;
        request.appGroupIdentifiers = {group};
        request.containerType = STWKernContainerTypeApplication;
        request.personaID = STWKernNoPersona;
        return request;
    }

    void _sendUpcall(const STWUpcallClient::Request& request) {
        STWErrorRef error;
        auto reply = _upcall->send(request, kTimeout, &error);
        if (!reply || reply->status != 1u || reply->appGroups.size() != 1)
            die("upcall failed: " + (error ? error->description() : std::string("status 0")));
    }

    // Command 0 for (identifier, class); dies unless it answers a path.
    void _command0(const std::string& identifier, uint64_t containerClass, bool create) {
        STWErrorRef error;
        auto reply = _client->sendMessage({{"Command", STWValue(uint64_t{0})},
                                           {"Identifier", STWValue(identifier)},
                                           {"ContainerClass", STWValue(containerClass)},
                                           {"CreateIfNecessary", STWValue(create)}},
                                          kTimeout, &error);
        if (!reply || !STWDictionaryString(*reply, "ReplyPath"))
            die("command 0 failed for " + identifier);
    }

    static void _report(const char* name, const std::vector<double>& upcall, const std::vector<double>& baseline,
                        const char* baselineName, const char* goal) {
        printf("  upcall:   p50 %7.1f us, p99 %7.1f us, mean %7.1f us (%zu)\n", percentile(upcall, 0.5),
               percentile(upcall, 0.99), mean(upcall), upcall.size());
        printf("  %s: p50 %7.1f us, p99 %7.1f us, mean %7.1f us (%zu)\n", baselineName, percentile(baseline, 0.5),
               percentile(baseline, 0.99), mean(baseline), baseline.size());
        printf("%s: ratio %.2f (goal %s)\n", name, mean(upcall) / mean(baseline), goal);
        fflush(stdout);
    }

    void _existingApp() {
        const std::string app = "com.example.bench.app", group = "group.com.example.bench";
        _command0(app, 2, true);
        _command0(group, 7, true);
        STWUpcallClient::Request request = _request(app, group);
        const size_t count = _quick ? 300 : 2000, rounds = _quick ? 2 : 5;
        auto upcall = [&](size_t) { _sendUpcall(request); };
        auto lookups = [&](size_t) {
            _command0(app, 2, false);
            _command0(group, 7, false);
        };
        timed(count / 4, upcall); // warm-up
        timed(count / 4, lookups);
        // Rounds alternate, so that whatever else the machine does weighs on both alike.
        std::vector<double> upcalls, pairs;
        for (size_t r = 0; r < rounds; r++) {
            auto u = timed(count, upcall);
            auto l = timed(count, lookups);
            upcalls.insert(upcalls.end(), u.begin(), u.end());
            pairs.insert(pairs.end(), l.begin(), l.end());
        }
        printf("an existing app container and one group:\n");
        _report("upcall_existing_app_and_group", upcalls, pairs, "2 x cmd 0", "<= 1.0");
    }

    void _firstLaunch() {
        const size_t count = _quick ? 40 : 200;
        auto upcalls = timed(count, [&](size_t i) {
            std::string n = std::to_string(i);
            _sendUpcall(_request("com.example.bench.new.u" + n, "group.com.example.bench.new.u" + n));
        });
        auto creations = timed(count, [&](size_t i) {
            std::string n = std::to_string(i);
            _command0("com.example.bench.new.c" + n, 2, true);
            _command0("group.com.example.bench.new.c" + n, 7, true);
        });
        printf("a new app container and a new group:\n");
        _report("upcall_first_launch", upcalls, creations, "2 x cmd 0", "<= 1.2");
    }

    const bool _quick;
    STWDaemonProcess _daemon;
    std::unique_ptr<STWClient> _client;
    std::unique_ptr<STWUpcallClient> _upcall;
};

} // namespace

int main(int argc, char** argv) {
    if (geteuid() != 0) {
        printf("stowly_bench_upcall: skipped, the upcall socket is root's alone\n");
        return 0;
    }
    bool quick = argc > 1 && strcmp(argv[1], "--quick") == 0;
    STWLog::setSystemLogLevel(STWLogLevel::Error);
    static bool daemonFailed = false;
    STWDaemonProcess::setFailureHandler([](const std::string& message) {
        fprintf(stderr, "stowly_bench_upcall: %s\n", message.c_str());
        daemonFailed = true;
    });
    try {
        UpcallBench bench(quick);
        bench.run();
    } catch (const std::exception& e) {
        fprintf(stderr, "stowly_bench_upcall: %s\n", e.what());
        return 1;
    }
    return daemonFailed ? 1 : 0;
}

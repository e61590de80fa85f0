// The upcall on the hot path of an application launch, against baselines measured in the
// same run on one daemon. Every app is installed first (command 18: data-container class 2
// and two app groups in its entitlements), as the kernel only asks for installed apps.
//
//   upcall_round_trips_1_sender, upcall_round_trips_8_senders  upcalls for an app whose data
//       container and two groups exist, from 1 and from 8 senders at once (each its own
//       connection), against an echo server in a process of its own, as the daemon is, on
//       a sequenced-packet socket that answers each request packet with the daemon's reply,
//       so both sides send, receive and decode the same bytes. The daemon serves upcalls one
//       at a time, so the echo server is one thread on an epoll loop; ratio = upcall round
//       trips per second / echo round trips per second, goal >= 0.5.
//   upcall_existing_app_and_groups  the same upcall, one sender, against command 0 looking up
//       the data container plus command 13 looking up the groups (two requests on one
//       connection); ratio = upcall time / requests time, goal <= 1.0: one upcall does the
//       work of the requests it saves a launch.
//   upcall_first_launch  the first upcall for a new app (data container and both groups
//       made), against command 0 creating the data container plus command 13 creating the
//       groups of another new app; ratio = upcall time / requests time, goal <= 1.2.
//
// Latencies are per round trip (p50, p99). On a virtual machine with few cores, a round trip
// whose two ends sit on different cores pays for waking an idle core, tens of microseconds,
// and where the scheduler happens to put the daemon's upcall thread and the echo server
// would decide the figures rather than their work. So the benchmark runs on the core it
// started on, and the daemon and the echo server, its children, inherit that; --all-cores
// lets the scheduler place everything. The daemon runs with its default settings plus
// developer mode on a private root in /tmp, its system log in a file. The upcall socket is
// root's alone, so the benchmark needs root. Usage: stowly_bench_upcall [--quick] [--all-cores]
#include "client/STWUpcallClient.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWFileIO.h"
#include "common/STWLog.h"
#include "tests/support/STWDaemonProcess.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <functional>
#include <latch>
#include <map>
#include <mutex>
#include <sched.h>
#include <stdexcept>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

namespace {

using Clock = std::chrono::steady_clock;
using Request = STWUpcallClient::Request;
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

double micros(Clock::duration d) {
    return std::chrono::duration<double, std::micro>(d).count();
}

// Microseconds each of `count` calls of `work(i)` took.
std::vector<double> timed(size_t count, const std::function<void(size_t)>& work) {
    std::vector<double> times;
    times.reserve(count);
    for (size_t i = 0; i < count; i++) {
        auto start = Clock::now();
        work(i);
        times.push_back(micros(Clock::now() - start));
    }
    return times;
}

void printLatencies(const char* name, const std::vector<double>& times) {
    printf("  %-12s p50 %7.1f us, p99 %7.1f us, mean %7.1f us (%zu)\n", name, percentile(times, 0.5),
           percentile(times, 0.99), mean(times), times.size());
}

// The baseline of the round trips: a process of its own, as the daemon is, with one thread
// on an epoll loop that answers every packet of every connection with the daemon's reply
// to it, one packet at a time, as the daemon serves upcalls; as simple as a server on this
// socket gets. This program runs it when started with --echo-server.
int echoServerMain(int listenFD, const char* replyFile) {
    std::string reply;
    if (STWReadFileContents(replyFile, &reply, STWReadDefault, 1 << 20) != 0)
        return 2;
    STWFileDescriptor epollFD(epoll_create1(EPOLL_CLOEXEC));
    auto watch = [&](int fd) {
        epoll_event event{};
        event.events = EPOLLIN;
        event.data.fd = fd;
        return epoll_ctl(epollFD.get(), EPOLL_CTL_ADD, fd, &event) == 0;
    };
    if (!epollFD || !watch(listenFD))
        return 2;
    std::map<int, STWFileDescriptor> connections;
    std::vector<char> packet(64 << 10);
    epoll_event events[16];
    for (;;) {
        int count = epoll_wait(epollFD.get(), events, 16, -1);
        for (int i = 0; i < count; i++) {
            int fd = events[i].data.fd;
            if (fd == listenFD) {
                STWFileDescriptor connection(accept4(fd, nullptr, nullptr, SOCK_CLOEXEC));
                if (connection && watch(connection.get()))
                    connections.emplace(connection.get(), std::move(connection));
            } else if (recv(fd, packet.data(), packet.size(), MSG_DONTWAIT) <= 0 ||
                       send(fd, reply.data(), reply.size(), MSG_DONTWAIT | MSG_NOSIGNAL) < 0) {
                connections.erase(fd); // closing it leaves the epoll set too
            }
        }
    }
}

class EchoServer {
public:
    EchoServer(const std::filesystem::path& path, const std::string& reply) : _path(path) {
        _replyFile = path;
        _replyFile += ".reply";
        if (STWWriteFile(_replyFile, reply, 0600, false) != 0)
            die("cannot write " + _replyFile.native());
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        if (path.native().size() >= sizeof address.sun_path)
            die("echo socket path too long");
        memcpy(address.sun_path, path.c_str(), path.native().size() + 1);
        // Listening before the server runs: connections wait in the backlog meanwhile.
        STWFileDescriptor listenFD(socket(AF_UNIX, SOCK_SEQPACKET, 0)); // inherited by the server
        if (!listenFD || bind(listenFD.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
            listen(listenFD.get(), SOMAXCONN) != 0)
            die(std::string("echo server: ") + strerror(errno));
        std::string fd = std::to_string(listenFD.get());
        _pid = fork();
        if (_pid == 0) {
            execl("/proc/self/exe", "stowly_bench_upcall", "--echo-server", fd.c_str(), _replyFile.c_str(), nullptr);
            _exit(127);
        }
        if (_pid < 0)
            die(std::string("echo server: ") + strerror(errno));
    }
    ~EchoServer() {
        kill(_pid, SIGTERM);
        waitpid(_pid, nullptr, 0);
        unlink(_path.c_str());
        unlink(_replyFile.c_str());
    }

private:
    const std::filesystem::path _path;
    std::filesystem::path _replyFile;
    pid_t _pid = -1;
};

// What `senders` connections at once did: how long they took together, and each round trip.
struct RoundTrips {
    double seconds = 0;
    std::vector<double> latencies;

    void add(const RoundTrips& other) {
        seconds += other.seconds;
        latencies.insert(latencies.end(), other.latencies.begin(), other.latencies.end());
    }
    double perSecond() const { return static_cast<double>(latencies.size()) / seconds; }
};

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
        std::unique_ptr<STWUpcallClient> upcall;
        while (!(upcall = _connectUpcall(&error)) && Clock::now() < deadline)
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        if (!upcall)
            die("cannot connect to the upcall socket: " + error->description());
    }

    void run() {
        _throughput();
        _existingApp();
        _firstLaunch();
    }

private:
    std::unique_ptr<STWUpcallClient> _connectUpcall(STWErrorRef* error) {
        return STWUpcallClient::connect(STWUpcallClient::socketPathForRoot(_daemon.root()), error);
    }

    static std::vector<std::string> _groupsOf(const std::string& app) { return {app + ".g1", app + ".g2"}; }

    static Request _request(const std::string& app) {
        Request request;
        request.codeSignatureIdentifier = app;
        request.uid = 501;
        request.appGroupIdentifiers = _groupsOf(app);
        request.containerType = STWKernContainerTypeApplication;
        request.personaID = STWKernNoPersona;
        return request;
    }

    // What an installer tells the daemon: an app with a class-2 data container and two groups.
    void _install(const std::string& app) {
        STWValue::Array groups;
        for (const std::string& group : _groupsOf(app))
            groups.emplace_back(group);
        STWValue::Dictionary entitlements{
            {"com.vorlane.security.application-groups", STWValue(std::move(groups))}};
        STWValue::Dictionary keys{
            {"Identifier", STWValue(app)},
            {"CodeSigningInfo", STWValue(STWValue::Dictionary{
                                    {"com.vorlane.Stowly.Entitlements", STWValue(std::move(entitlements))}})},
            {"OptionsDictionary", STWValue(STWValue::Dictionary{
                                      {"com.vorlane.Stowly.DataContainerClass", STWValue(uint64_t{2})}})}};
        if (uint64_t code = STWDaemonProcess::replyError(*_client, 18, keys); code != STWErrorSuccess)
            die("command 18 failed for " + app + ": " + std::to_string(code));
    }

    // One upcall; dies unless every container came back.
    static void _sendUpcall(STWUpcallClient& upcall, const Request& request) {
        STWErrorRef error;
        auto reply = upcall.send(request, kTimeout, &error);
        if (!reply || reply->status != 1u || reply->appGroups.size() != request.appGroupIdentifiers.size())
            die("upcall failed: " + (error ? error->description() : std::string("status 0")));
    }

    // Command 0 for the app's data container, then command 13 for its groups; dies unless
    // both answer their paths.
    void _requests(const std::string& app, bool create) {
        STWErrorRef error;
        auto data = _client->sendMessage({{"Command", STWValue(uint64_t{0})},
                                          {"Identifier", STWValue(app)},
                                          {"ContainerClass", STWValue(uint64_t{2})},
                                          {"CreateIfNecessary", STWValue(create)}},
                                         kTimeout, &error);
        if (!data || !STWDictionaryString(*data, "ReplyPath"))
            die("command 0 failed for " + app);
        auto groups = _client->sendMessage(
            {{"Command", STWValue(uint64_t{13})}, {"Identifier", STWValue(app)}}, kTimeout, &error);
        const STWValue::Dictionary* paths =
            groups ? STWDictionaryDictionary(*groups, "ReplyGroupContainerDict") : nullptr;
        if (!paths || paths->size() != 2)
            die("command 13 failed for " + app + ": " +
                std::to_string(groups ? STWDictionaryUInt64(*groups, "ReplyError").value_or(0) : 0));
    }

    // `count` round trips split over `senders` connections made by `connect`, all at once.
    static RoundTrips _roundTrips(size_t senders, size_t count, const Request& request,
                                  const std::function<std::unique_ptr<STWUpcallClient>()>& connect) {
        std::vector<std::unique_ptr<STWUpcallClient>> clients;
        for (size_t i = 0; i < senders; i++)
            if (!clients.emplace_back(connect()))
                die("cannot connect a sender");
        std::vector<std::vector<double>> latencies(senders);
        std::latch ready(static_cast<ptrdiff_t>(senders) + 1);
        std::vector<std::thread> threads;
        std::mutex failureMutex;
        std::string failure;
        for (size_t i = 0; i < senders; i++)
            threads.emplace_back([&, i] {
                ready.arrive_and_wait();
                try {
                    latencies[i] = timed(count / senders, [&](size_t) { _sendUpcall(*clients[i], request); });
                } catch (const std::exception& e) {
                    std::lock_guard lock(failureMutex);
                    failure = e.what();
                }
            });
        ready.arrive_and_wait();
        auto start = Clock::now();
        for (std::thread& t : threads)
            t.join();
        RoundTrips result;
        result.seconds = std::chrono::duration<double>(Clock::now() - start).count();
        if (!failure.empty())
            die(failure);
        for (const auto& l : latencies)
            result.latencies.insert(result.latencies.end(), l.begin(), l.end());
        return result;
    }

    void _throughput() {
        const std::string app = "com.example.bench.app";
        _install(app);
        Request request = _request(app);
        auto upcall = _connectUpcall(nullptr);
        if (!upcall)
            die("cannot connect to the upcall socket");
        _sendUpcall(*upcall, request); // makes the containers
        STWErrorRef error;
        auto reply = upcall->exchangePacket(
            STWUpcallClient::packetWithBuffer(STWUpcallClient::packedBufferForRequest(request)), kTimeout,
            &error);
        if (!reply)
            die("upcall failed: " + error->description());
        EchoServer echo(_daemon.root() / "echo.sock", *reply);
        using Connect = std::function<std::unique_ptr<STWUpcallClient>()>;
        Connect connectEcho = [&] { return STWUpcallClient::connect(_daemon.root() / "echo.sock", nullptr); };
        Connect connectDaemon = [&] { return _connectUpcall(nullptr); };

        const size_t count = _quick ? 2000 : 16000, rounds = _quick ? 2 : 4;
        for (size_t senders : {size_t{1}, size_t{8}}) {
            _roundTrips(senders, count / 4, request, connectEcho); // warm-up
            _roundTrips(senders, count / 4, request, connectDaemon);
            // Rounds alternate, so that whatever else the machine does weighs on both alike.
            RoundTrips upcalls, echoes;
            for (size_t r = 0; r < rounds; r++) {
                upcalls.add(_roundTrips(senders, count, request, connectDaemon));
                echoes.add(_roundTrips(senders, count, request, connectEcho));
            }
            double upcallRate = upcalls.perSecond(), echoRate = echoes.perSecond();
            printf("an existing app container and two groups, %zu sender%s:\n", senders,
                   senders == 1 ? "" : "s");
            printLatencies("upcall:", upcalls.latencies);
            printLatencies("echo:", echoes.latencies);
            printf("  upcall %.0f/s, echo %.0f/s\n", upcallRate, echoRate);
            printf("upcall_round_trips_%zu_sender%s: ratio %.2f (goal >= 0.5)\n", senders,
                   senders == 1 ? "" : "s", upcallRate / echoRate);
            fflush(stdout);
        }
    }

    static void _report(const char* name, const std::vector<double>& upcall,
                        const std::vector<double>& baseline, const char* goal) {
        printLatencies("upcall:", upcall);
        printLatencies("cmd 0 + 13:", baseline);
        printf("%s: ratio %.2f (goal %s)\n", name, mean(upcall) / mean(baseline), goal);
        fflush(stdout);
    }

    void _existingApp() {
        const std::string app = "com.example.bench.app"; // installed and made by _throughput
        Request request = _request(app);
        auto upcall = _connectUpcall(nullptr);
        if (!upcall)
            die("cannot connect to the upcall socket");
        const size_t count = _quick ? 300 : 2000, rounds = _quick ? 2 : 5;
        auto upcalls = [&](size_t) { _sendUpcall(*upcall, request); };
        auto requests = [&](size_t) { _requests(app, false); };
        timed(count / 4, upcalls); // warm-up
        timed(count / 4, requests);
        std::vector<double> u, r;
        for (size_t i = 0; i < rounds; i++) {
            auto a = timed(count, upcalls);
            auto b = timed(count, requests);
            u.insert(u.end(), a.begin(), a.end());
            r.insert(r.end(), b.begin(), b.end());
        }
        printf("an existing app container and two groups, against requests:\n");
        _report("upcall_existing_app_and_groups", u, r, "<= 1.0");
    }

    void _firstLaunch() {
        const size_t count = _quick ? 40 : 200;
        auto upcallApp = [](size_t i) { return "com.example.bench.new.u" + std::to_string(i); };
        auto requestApp = [](size_t i) { return "com.example.bench.new.c" + std::to_string(i); };
        for (size_t i = 0; i < count; i++) {
            _install(upcallApp(i));
            _install(requestApp(i));
        }
        auto upcall = _connectUpcall(nullptr);
        if (!upcall)
            die("cannot connect to the upcall socket");
        // Interleaved, so that both see the same number of containers around them.
        std::vector<double> u, r;
        for (size_t i = 0; i < count; i++) {
            Request request = _request(upcallApp(i));
            u.push_back(timed(1, [&](size_t) { _sendUpcall(*upcall, request); })[0]);
            r.push_back(timed(1, [&](size_t) { _requests(requestApp(i), true); })[0]);
        }
        printf("a new app: its data container and two groups made:\n");
        _report("upcall_first_launch", u, r, "<= 1.2");
    }

    const bool _quick;
    STWDaemonProcess _daemon;
    std::unique_ptr<STWClient> _client;
};

} // namespace

int main(int argc, char** argv) {
    if (argc == 4 && strcmp(argv[1], "--echo-server") == 0)
        return echoServerMain(atoi(argv[2]), argv[3]);
    if (geteuid() != 0) {
        printf("stowly_bench_upcall: skipped, the upcall socket is root's alone\n");
        return 0;
    }
    bool quick = false, allCores = false;
    for (int i = 1; i < argc; i++) {
        quick = quick || strcmp(argv[i], "--quick") == 0;
        allCores = allCores || strcmp(argv[i], "--all-cores") == 0;
    }
    if (!allCores) {
        cpu_set_t one;
        CPU_ZERO(&one);
        int cpu = sched_getcpu();
        CPU_SET(cpu < 0 ? 0 : cpu, &one);
        if (sched_setaffinity(0, sizeof one, &one) == 0)
            printf("on CPU %d with the daemon and the echo server (--all-cores: anywhere)\n", cpu < 0 ? 0 : cpu);
    }
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

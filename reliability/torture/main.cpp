// stowly_torture: a real stowlyd on a private root, driven by several client threads while
// it is killed again and again (at random moments, and in turn at every crash point), with
// a power cycle now and then; after each restart, once the start's cleanups are done, the
// independent checker compares the disk and the daemon's answers with every acknowledged
// reply. Prints "kills: N, violations: M" and a summary; exits 1 when M > 0.
//
// With --faults N it runs N fault rounds instead of kills: the same workload against a
// daemon started with a random list of I/O faults (STOWLY_FAULT), which must answer every
// request in time with a code it defines and never die; a reply with an error acknowledges
// nothing. Each round ends with a clean stop and a start without faults, after which the
// checker looks at what the faults left. Prints "fault rounds: N, faults fired: F,
// violations: M".
//
// Every fourth thread (1, 5, ...) has its applications assigned to an enterprise persona
// with a home of its own: their data and group containers live there, and the checker
// scans that home too and checks which persona each per-user container records.
//
// With --soak SECONDS it neither kills nor faults: 64 client threads (--threads) drive one
// daemon for that long; it reports the requests, the errors (replies the workload does not
// expect, and missing replies), the latency and the daemon's resident memory and open
// descriptors after a warm-up (a tenth of the time) and at the end, which must not have
// grown beyond 10% (descriptors: 10% and 8).
//
//   stowly_torture [--kills N | --faults N | --soak SECONDS] [--seed S] [--threads T]
//                  [--state FILE] [--verbose]
//
// FILE, when given, holds the root, the first-boot semaphore and the daemon's pid, so that
// a script can clean up after a driver that was itself killed.
#include "common/STWFileIO.h"
#include "common/STWLog.h"
#include "platform/STWCrashPoint.h"
#include "platform/STWFilePersonaService.h"
#include "platform/STWPlatformConfiguration.h"
#include "tests/support/STWDaemonProcess.h"
#include "tests/support/STWTestRoot.h"
#include "reliability/torture/STWTortureChecker.h"
#include "reliability/torture/STWTortureWorkload.h"

#include <algorithm>
#include <cerrno>
#include <atomic>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <functional>
#include <memory>
#include <random>
#include <semaphore.h>
#include <string>
#include <thread>
#include <vector>

namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;

std::atomic<bool> interrupted{false};

const STWValue::Dictionary installerEntitlements{{"com.vorlane.private.Stowly.allowed", STWValue(true)}};

// The enterprise persona of every fourth thread, and where its home lies below the root.
constexpr const char* enterprisePersona = "TORTURE-ENTERPRISE";
constexpr uint32_t enterprisePersonaID = 1001;
constexpr const char* enterpriseHome = "private/var/enterprise/torture";
bool isEnterpriseThread(unsigned index) { return index % 4 == 1; }

// The personal persona of the mobile user (as the daemon assumes without a list) and the
// enterprise persona, to which the enterprise threads' applications are assigned.
STWValue::Array personas(unsigned threads) {
    STWValue::Array applications;
    for (unsigned t = 0; t < threads; ++t)
        for (unsigned k = 0; isEnterpriseThread(t) && k < STWTortureWorker::applicationCount; ++k)
            applications.emplace_back(STWTortureWorker::application(t, k));
    STWValue::Dictionary enterprise =
        *STWTestRoot::persona(enterprisePersona, enterprisePersonaID, "enterprise", std::move(applications),
                              (std::string("/") + enterpriseHome).c_str())
             .dictionary();
    // The kernel's type number of such a persona, by which the upcall serves its processes
    // from the persona's home.
    enterprise["KernelType"] = STWValue(2u);
    return {STWTestRoot::persona(STWFilePersonaService::defaultPersonalUniqueString, 501, "personal"),
            STWValue(enterprise)};
}

struct Options {
    unsigned kills = 1000;
    unsigned faultRounds = 0; // > 0: the fault mode
    unsigned soakSeconds = 0; // > 0: the soak
    uint64_t seed = 0;
    unsigned threads = 4;
    std::string stateFile;
    bool verbose = false;
};

bool parse(int argc, char** argv, Options* options) {
    options->seed = std::random_device()();
    bool threadsGiven = false;
    for (int i = 1; i < argc; ++i) {
        std::string arg = argv[i];
        auto next = [&](unsigned long long* value) {
            if (i + 1 >= argc)
                return false;
            char* end = nullptr;
            *value = strtoull(argv[++i], &end, 10);
            return end && *end == 0;
        };
        unsigned long long value = 0;
        threadsGiven = threadsGiven || arg == "--threads";
        if (arg == "--kills" && next(&value) && value > 0)
            options->kills = unsigned(value);
        else if (arg == "--faults" && next(&value) && value > 0)
            options->faultRounds = unsigned(value);
        else if (arg == "--seed" && next(&value))
            options->seed = value;
        else if (arg == "--soak" && next(&value) && value > 0)
            options->soakSeconds = unsigned(value);
        else if (arg == "--threads" && next(&value) && value > 0 && value <= 64)
            options->threads = unsigned(value);
        else if (arg == "--state" && i + 1 < argc)
            options->stateFile = argv[++i];
        else if (arg == "--verbose")
            options->verbose = true;
        else
            return false;
    }
    if (options->soakSeconds && !threadsGiven)
        options->threads = 64;
    return !(options->soakSeconds && options->faultRounds);
}

class Torture {
public:
    explicit Torture(const Options& options)
        : _options(options), _random(options.seed),
          _daemon({{"DeveloperMode", STWValue(true)}, {"InternalImage", STWValue(true)}}, personas(options.threads),
                  false),
          _checker(_daemon.root()) {
        _daemon.setStandardErrorFile(_daemon.root() / "stowlyd.stderr");
        _checker.recordedProtectionMayLag = options.faultRounds > 0;
        _checker.enterpriseHomes[enterpriseHome] = enterprisePersona;
        for (unsigned t = 0; t < options.threads; ++t) {
            _workers.push_back(std::make_unique<STWTortureWorker>(t, options.seed, _daemon.root().string()));
            if (isEnterpriseThread(t))
                _workers.back()->setPersona(enterprisePersona, enterprisePersonaID);
            if (options.faultRounds)
                _workers.back()->setMode(STWTortureWorker::Mode::Faults);
            else if (options.soakSeconds)
                _workers.back()->setMode(STWTortureWorker::Mode::Steady);
        }
    }

    int run();

private:
    void _runKills();
    void _runFaults();
    void _runSoak();
    // Runs every worker on a thread of its own, with a connection of its own, while
    // `meanwhile` runs; stops and joins them after it.
    void _drive(const std::string& focus, const std::function<void()>& meanwhile);
    std::string _randomFaults();
    void _faultRound();
    // Starts the daemon (armed at `point` unless empty) and waits for its cleanups; a daemon
    // that kills itself on the way counts as a kill and is started again unarmed.
    bool _restart(std::string point, bool firstBoot);
    void _window(const std::string& point);
    void _check();
    // Tells the checker which containers the daemon's log, since the last call, says could
    // be neither moved to death row nor removed.
    void _readUndeletable();
    void _violation(const std::string& text);
    void _writeState();
    std::unique_ptr<STWClient> _installer() { return _daemon.connectAs("com.torture.installer", installerEntitlements); }

    Options _options;
    std::mt19937_64 _random;
    STWDaemonProcess _daemon;
    STWTortureChecker _checker;
    std::vector<std::unique_ptr<STWTortureWorker>> _workers;
    std::streamoff _logRead = 0;
    unsigned _rounds = 0;
    struct Usage {
        long residentKB = -1;
        long descriptors = -1;
    } _warm, _end;
    Usage _usage() const;
    unsigned _kills = 0, _pointKills = 0, _startKills = 0, _reboots = 0, _checks = 0;
    uint64_t _containersChecked = 0, _enterpriseChecked = 0; // summed over the checks
    std::vector<std::string> _violations;
};

void Torture::_violation(const std::string& text) {
    _violations.push_back(text);
    std::string history;
    for (auto& worker : _workers)
        history += worker->historyFor(text);
    if (_violations.size() <= 50)
        fprintf(stderr, "VIOLATION after %s %u (reproduce with --seed %llu): %s%s\n",
                _options.faultRounds ? "fault round" : "kill", _options.faultRounds ? _rounds : _kills,
                static_cast<unsigned long long>(_options.seed), text.c_str(), history.c_str());
}

void Torture::_writeState() {
    if (_options.stateFile.empty())
        return;
    std::ofstream(_options.stateFile) << _daemon.root().string() << "\n/dev/shm/sem."
                                      << STWPlatformConfiguration(_daemon.root()).firstBootSemaphoreName().substr(1)
                                      << "\n" << _daemon.pid() << "\n";
}

bool Torture::_restart(std::string point, bool firstBoot) {
    for (int attempt = 0; attempt < 5; ++attempt) {
        bool started = point.empty() ? _daemon.start() : _daemon.startWith("STOWLY_CRASH_AT", point);
        _writeState();
        if (started && _daemon.waitForCleanups(firstBoot))
            return true;
        // A start or its cleanups reached the armed point: a crash during repair.
        auto status = _daemon.waitForExit(STWDaemonProcess::timeout);
        if (!status || point.empty()) {
            _violation("stowlyd did not start" + std::string(point.empty() ? "" : " armed at " + point) +
                       (status ? " (wait status " + std::to_string(*status) + ")" : ""));
            return false;
        }
        ++_kills, ++_pointKills, ++_startKills;
        if (_options.verbose)
            fprintf(stderr, "kill %u: at %s during the start\n", _kills, point.c_str());
        point.clear();
        // A daemon that finished its first-boot cleanup before it died left its marker, and
        // the next start is no first one.
        sem_t* marker = sem_open(STWPlatformConfiguration(_daemon.root()).firstBootSemaphoreName().c_str(), 0);
        if (marker != SEM_FAILED) {
            sem_close(marker);
            firstBoot = false;
        }
    }
    return false;
}

void Torture::_drive(const std::string& focus, const std::function<void()>& meanwhile) {
    std::atomic<bool> stop{false};
    std::vector<std::unique_ptr<STWClient>> clients;
    std::vector<std::unique_ptr<STWUpcallClient>> upcalls;
    std::vector<std::thread> threads;
    for (auto& worker : _workers) {
        clients.push_back(_installer());
        upcalls.push_back(STWUpcallClient::connect(STWUpcallClient::socketPathForRoot(_daemon.root()), nullptr));
        if (!clients.back()) {
            // A killed daemon may refuse; one under faults must not.
            if (_options.faultRounds)
                _violation("stowlyd refused a connection");
            continue;
        }
        threads.emplace_back([&, w = worker.get(), c = clients.back().get(), u = upcalls.back().get()] {
            w->run(*c, u, stop, focus);
        });
    }
    meanwhile();
    stop = true;
    for (auto& thread : threads)
        thread.join();
}

void Torture::_window(const std::string& point) {
    std::optional<int> status;
    bool reached = false;
    _drive(point, [&] {
        // Armed, the daemon is given a while to reach its point; otherwise it is killed after
        // a short random stretch of work, so kills land at every stage of every request.
        milliseconds window = point.empty() ? milliseconds(20 + _random() % 300) : milliseconds(1500);
        status = _daemon.waitForExit(window);
        reached = status.has_value();
        if (!status) {
            kill(_daemon.pid(), SIGKILL);
            status = _daemon.waitForExit(STWDaemonProcess::timeout);
        }
    });
    ++_kills;
    if (!point.empty() && reached)
        ++_pointKills;
    if (!status || !WIFSIGNALED(*status) || WTERMSIG(*status) != SIGKILL)
        _violation("stowlyd ended otherwise than by SIGKILL" +
                   (status ? " (wait status " + std::to_string(*status) + ")" : std::string(" (still running)")));
    if (_options.verbose)
        fprintf(stderr, "kill %u: %s\n", _kills,
                point.empty() ? "at random" : (point + (reached ? " reached" : " not reached")).c_str());
}

void Torture::_readUndeletable() {
    std::ifstream log(_daemon.root() / "stowlyd.stderr");
    log.seekg(_logRead);
    const std::string marker = "Failed to delete container at ";
    for (std::string line; std::getline(log, line);) {
        size_t at = line.find(marker);
        if (at == std::string::npos)
            continue;
        std::string path = line.substr(at + marker.size());
        path = path.substr(0, path.find(": "));
        while (path.size() > 1 && path.back() == '/')
            path.pop_back();
        _checker.undeletable.insert(path);
    }
    log.clear();
    if (auto end = log.tellg(); end >= 0)
        _logRead = end;
}

void Torture::_check() {
    ++_checks;
    if (_options.faultRounds)
        _readUndeletable();
    std::vector<STWTortureModel*> models;
    for (auto& worker : _workers)
        models.push_back(&worker->model);
    std::vector<std::string> found = _checker.check(models);

    std::map<STWTortureIdentity, std::pair<std::string, std::string>> disk;
    for (const auto& [identity, container] : _checker.found()) {
        disk[identity] = {container.uuid, container.path};
        _enterpriseChecked += container.persona == enterprisePersona;
    }
    _containersChecked += _checker.found().size();
    auto client = _installer();
    // A group container is no application of a persona: the daemon looks it up in the
    // caller's, so an enterprise thread's containers are asked for as that persona.
    auto enterpriseClient = _daemon.connectAs("com.torture.installer", installerEntitlements, false, enterprisePersona);
    std::vector<STWTortureIdentity> mapped;
    for (auto& worker : _workers) {
        // What the workload itself saw contradict its record during the window counts too.
        found.insert(found.end(), worker->violations.begin(), worker->violations.end());
        worker->violations.clear();
        STWClient* asker = worker->model.persona.empty() ? client.get() : enterpriseClient.get();
        if (asker) {
            worker->compareWithDaemon(*asker, disk);
            found.insert(found.end(), worker->violations.begin(), worker->violations.end());
            worker->violations.clear();
        }
        auto more = worker->mappedIdentities();
        mapped.insert(mapped.end(), more.begin(), more.end());
    }
    // Before the resent updates, which may send groups away (and reach an armed point).
    for (auto& v : _checker.checkMappings(mapped))
        found.push_back(std::move(v));
    for (auto& worker : _workers)
        if (client)
            worker->resolve(*client);
    // A daemon armed at a point that its own death-row pass or a resent update reached
    // died during the check: what it left unfinished is the next start's to repair.
    bool died = !_daemon.isRunning();
    // A connection reset comes a moment before the daemon that closed it can be reaped.
    bool unanswered = std::any_of(found.begin(), found.end(),
                                  [](const std::string& v) { return v.find("no reply") != std::string::npos; });
    if (!died && unanswered)
        died = _daemon.waitForExit(milliseconds(500)).has_value();
    for (auto& v : found)
        if (!died || (v.find("death row entry") == std::string::npos && v.find("no reply") == std::string::npos))
            _violation(v);
    if (died) {
        ++_kills, ++_pointKills;
        _daemon.waitForExit(STWDaemonProcess::timeout);
    }
}

// The points of the daemon's file layer that STOWLY_FAULT can fail, and the errors it
// fails them with: a full disk, a failing device, a refused permission.
constexpr const char* faultPoints[] = {"mkdirat", "create",   "write",    "fsync",    "renameat2",
                                       "fchown",  "fchmod",   "setxattr", "setflags", "unlinkat"};
constexpr int faultErrors[] = {ENOSPC, EIO, EACCES};

std::string Torture::_randomFaults() {
    // Two to four points, each failing at one of its first calls (a point holds one fault).
    std::vector<const char*> points(std::begin(faultPoints), std::end(faultPoints));
    std::shuffle(points.begin(), points.end(), _random);
    std::string list;
    for (size_t i = 0, n = 2 + _random() % 3; i < n; ++i)
        list += (list.empty() ? "" : ",") + std::string(points[i]) + ":" + std::to_string(1 + _random() % 12) + ":" +
                std::to_string(faultErrors[_random() % std::size(faultErrors)]);
    return list;
}

void Torture::_faultRound() {
    ++_rounds;
    std::string faults = _randomFaults();
    if (_daemon.isRunning() && !_daemon.stop())
        _violation("stowlyd did not stop cleanly before the faults " + faults);
    bool armed = _daemon.startWith("STOWLY_FAULT", faults);
    _writeState();
    if (!armed || !_daemon.waitForCleanups(false)) {
        _violation("stowlyd did not start with the faults " + faults);
    } else {
        _drive("", [&] { std::this_thread::sleep_for(milliseconds(600 + _random() % 600)); });
        for (auto& worker : _workers) {
            for (auto& v : worker->violations)
                _violation(v + " (faults " + faults + ")");
            worker->violations.clear();
        }
        if (!_daemon.isRunning())
            _violation("stowlyd died under the faults " + faults);
        else if (!_daemon.stop())
            _violation("stowlyd did not stop cleanly after the faults " + faults);
    }
    if (_options.verbose)
        fprintf(stderr, "fault round %u: %s\n", _rounds, faults.c_str());
    // The faults are spent or dropped with the process: the start without them repairs what
    // they left, and the check follows its cleanups. It is a first start since power-on: a
    // removal that failed half-way leaves a directory without metadata in its class
    // directory, which is no container and only the first-boot sweep removes.
    bool started = _daemon.isRunning();
    if (!started) {
        _daemon.reboot();
        started = _restart("", true);
    }
    if (started)
        _check();
    if (!_daemon.isRunning())
        _violation("stowlyd died after the faults " + faults + ", without them");
}

void Torture::_runFaults() {
    while (_rounds < _options.faultRounds && !interrupted.load() && _violations.size() <= 200)
        _faultRound();
}

Torture::Usage Torture::_usage() const {
    Usage usage;
    std::ifstream status("/proc/" + std::to_string(_daemon.pid()) + "/status");
    for (std::string line; std::getline(status, line);)
        if (line.starts_with("VmRSS:"))
            usage.residentKB = strtol(line.c_str() + 6, nullptr, 10);
    std::error_code ec;
    long count = 0;
    for (std::filesystem::directory_iterator it("/proc/" + std::to_string(_daemon.pid()) + "/fd", ec), end;
         !ec && it != end; it.increment(ec))
        ++count;
    if (!ec)
        usage.descriptors = count;
    return usage;
}

void Torture::_runSoak() {
    auto began = Clock::now();
    auto sleepUntil = [](Clock::time_point when) {
        while (Clock::now() < when && !interrupted.load())
            std::this_thread::sleep_for(milliseconds(100));
    };
    _drive("", [&] {
        sleepUntil(began + std::chrono::seconds(_options.soakSeconds) / 10);
        _warm = _usage();
        sleepUntil(began + std::chrono::seconds(_options.soakSeconds));
        _end = _usage();
    });
    for (auto& worker : _workers) {
        for (auto& v : worker->violations)
            _violation(v);
        worker->violations.clear();
    }
    if (!_daemon.isRunning())
        return _violation("stowlyd died during the soak");
    // What requests sent to death row without starting a pass waits for the next one, at the
    // latest the next start's cleanup: the checker looks after a restart, as after a kill.
    if (!_daemon.stop() || !_daemon.start() || !_daemon.waitForCleanups(false))
        return _violation("stowlyd did not stop and start again cleanly after the soak");
    _check();
}

int Torture::run() {
    auto began = Clock::now();
    printf("stowly_torture: root %s, seed %llu, %u threads, %u %s\n", _daemon.root().c_str(),
           static_cast<unsigned long long>(_options.seed), _options.threads,
           _options.faultRounds ? _options.faultRounds : _options.soakSeconds ? _options.soakSeconds : _options.kills,
           _options.faultRounds ? "fault rounds" : _options.soakSeconds ? "seconds of soak" : "kills");
    fflush(stdout);
    if (!_restart("", true))
        return 1;
    if (_options.faultRounds)
        _runFaults();
    else if (_options.soakSeconds)
        _runSoak();
    else
        _runKills();
    double seconds = std::chrono::duration<double>(Clock::now() - began).count();
    uint64_t acknowledged = 0, uncertain = 0, failed = 0;
    std::map<std::string, std::pair<uint64_t, uint64_t>> kinds;
    for (auto& worker : _workers) {
        failed += worker->failed;
        for (auto& [kind, n] : worker->acknowledged)
            acknowledged += n, kinds[kind].first += n;
        for (auto& [kind, n] : worker->uncertain)
            uncertain += n, kinds[kind].second += n;
    }
    printf("requests acknowledged: %llu, not acknowledged: %llu (answered with an error: %llu)\n",
           static_cast<unsigned long long>(acknowledged), static_cast<unsigned long long>(uncertain),
           static_cast<unsigned long long>(failed));
    for (auto& [kind, counts] : kinds)
        printf("  %-16s %8llu acknowledged %6llu not\n", kind.c_str(),
               static_cast<unsigned long long>(counts.first), static_cast<unsigned long long>(counts.second));
    if (!_options.faultRounds && !_options.soakSeconds)
        printf("crash points reached: %u (during a start or its check: %u), power cycles: %u, checks: %u\n",
               _pointKills, _startKills, _reboots, _checks);
    if (_checks)
        printf("containers at a check: %.1f on average, %.1f of them the enterprise persona's\n",
               double(_containersChecked) / _checks, double(_enterpriseChecked) / _checks);
    printf("wall time: %.1f s, seed %llu\n", seconds, static_cast<unsigned long long>(_options.seed));
    if (!_violations.empty()) {
        // The root goes with the driver; the daemon's log stays for whoever looks into it.
        std::string kept = "/tmp/stowly-torture-" + std::to_string(_options.seed) + ".log";
        std::error_code ec;
        std::filesystem::copy_file(_daemon.root() / "stowlyd.stderr", kept,
                                   std::filesystem::copy_options::overwrite_existing, ec);
        if (!ec)
            printf("the daemon's log: %s\n", kept.c_str());
    }
    if (_options.soakSeconds) {
        uint64_t requests = 0;
        std::map<std::string, std::vector<uint32_t>> byKind;
        std::vector<uint32_t> all;
        for (auto& worker : _workers) {
            requests += worker->requests;
            for (auto& [kind, latencies] : worker->latencies) {
                byKind[kind].insert(byKind[kind].end(), latencies.begin(), latencies.end());
                all.insert(all.end(), latencies.begin(), latencies.end());
            }
        }
        auto percentile = [](std::vector<uint32_t>& latencies, double p) {
            std::sort(latencies.begin(), latencies.end());
            return latencies.empty() ? 0.0 : latencies[size_t(p * double(latencies.size() - 1))] / 1000.0;
        };
        for (auto& [kind, latencies] : byKind)
            printf("  %-16s latency p50 %8.2f ms, p99 %8.2f ms\n", kind.c_str(), percentile(latencies, 0.5),
                   percentile(latencies, 0.99));
        // Measured while the load runs; the bound is not about timing, only growth.
        // A short soak sees the allocator still settling: its memory is reported, and held to
        // the bound from two minutes on.
        bool residentGated = _options.soakSeconds >= 120;
        bool residentOK = _warm.residentKB > 0 && _end.residentKB > 0 &&
                          (_end.residentKB <= _warm.residentKB * 11 / 10 || !residentGated);
        bool descriptorsOK = _warm.descriptors > 0 && _end.descriptors >= 0 &&
                             _end.descriptors <= _warm.descriptors * 11 / 10 + 8;
        printf("latency p50: %.2f ms, p99: %.2f ms (reported, not checked)\n", percentile(all, 0.5),
               percentile(all, 0.99));
        printf("resident memory: %ld kB after the warm-up, %ld kB at the end: %s\n", _warm.residentKB,
               _end.residentKB,
               !residentGated ? "reported" : residentOK ? "pass" : "FAIL (more than 10% growth)");
        printf("open descriptors: %ld after the warm-up, %ld at the end: %s\n", _warm.descriptors, _end.descriptors,
               descriptorsOK ? "pass" : "FAIL (more than 10% + 8 growth)");
        printf("soak: requests: %llu, errors: %zu\n", static_cast<unsigned long long>(requests), _violations.size());
        return _violations.empty() && residentOK && descriptorsOK && !interrupted.load() ? 0 : 1;
    }
    if (_options.faultRounds) {
        // Every fault that fires is logged, and the log gathers every start's.
        unsigned fired = 0;
        std::ifstream log(_daemon.root() / "stowlyd.stderr");
        for (std::string line; std::getline(log, line);)
            fired += line.find("Injected fault: ") != std::string::npos;
        printf("fault rounds: %u, faults fired: %u, violations: %zu\n", _rounds, fired, _violations.size());
        printf("containers a failed deletion left in place: %zu\n", _checker.undeletable.size());
    } else {
        printf("kills: %u, violations: %zu\n", _kills, _violations.size());
    }
    return _violations.empty() && !interrupted.load() ? 0 : 1;
}

void Torture::_runKills() {
    size_t nextPoint = 0;
    std::string point;
    while (_kills < _options.kills && !interrupted.load()) {
        if (_daemon.isRunning())
            _window(point);
        // Every few kills the power goes too, and the next start is the first since power-on.
        bool firstBoot = _random() % 5 == 0;
        if (firstBoot) {
            _daemon.reboot();
            ++_reboots;
        }
        // Clients find the device unlocked after a restart, so waiting changes can finish.
        STWWriteFileAtomically(_daemon.root() / "run/stowly/keybag", "unlocked", 0644, false);
        // Every second start is armed, at each crash point in turn (a later pass of it now
        // and then); the list is walked as it stands, so new points join by themselves.
        point.clear();
        if (_kills % 2 == 1) {
            point = std::string(STWCrashPoint::all[nextPoint++ % STWCrashPoint::all.size()]);
            if (_random() % 3 == 0)
                point += ":" + std::to_string(2 + _random() % 2);
        }
        if (!_restart(point, firstBoot))
            break;
        _check();
        if (_violations.size() > 200)
            break;
    }
}

} // namespace

int main(int argc, char** argv) {
    Options options;
    if (!parse(argc, argv, &options)) {
        fprintf(stderr,
                "usage: %s [--kills N | --faults N | --soak SECONDS] [--seed S] [--threads T] [--state FILE] "
                "[--verbose]\n",
                argv[0]);
        return 2;
    }
    // Stopped from outside, the driver still stops its daemon and removes its root.
    struct sigaction action{};
    action.sa_handler = [](int) { interrupted = true; };
    for (int signal : {SIGINT, SIGTERM, SIGHUP})
        sigaction(signal, &action, nullptr);
    signal(SIGPIPE, SIG_IGN);
    // The file layer that removes the root at the end logs every immutable flag it clears.
    if (!options.verbose)
        STWLog::setSystemLogLevel(STWLogLevel::Fault);
    STWDaemonProcess::setFailureHandler([verbose = options.verbose](const std::string& message) {
        if (verbose)
            fprintf(stderr, "stowly_torture: %s\n", message.c_str());
    });
    int status;
    {
        Torture torture(options);
        status = torture.run();
    }
    if (!options.stateFile.empty())
        unlink(options.stateFile.c_str());
    return status;
}

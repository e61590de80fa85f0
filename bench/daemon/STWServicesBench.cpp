// The per-container services over stowlyd's socket, each against a baseline measured in the
// same run on the same disk:
//
//   disk_usage_10000_files  a disk-usage request for a data container of 10,000 files
//       against `du -s -B1` of the same directory; ratio = daemon time / du time.
//   set_info_value  a set-info-value request against writing the same metadata file
//       directly: a temporary file written and synced, renamed over the old one, the
//       directory synced; ratio = daemon time / direct time.
//
// Medians of interleaved runs, so that a burst of other work on the machine hits both.
// Usage: stowly_bench_services [--quick]
#include "bench/support/STWBenchSupport.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWError.h"
#include "common/STWFileIO.h"
#include "common/STWLog.h"
#include "tests/support/STWDaemonProcess.h"

#include <chrono>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <fstream>
#include <stdexcept>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

namespace fs = std::filesystem;

namespace {

using Clock = std::chrono::steady_clock;

double micros(Clock::duration d) { return std::chrono::duration<double, std::micro>(d).count(); }

using STWBench::median;

[[noreturn]] void die(const std::string& message) { throw std::runtime_error(message); }

STWValue::Dictionary checked(STWClient& client, uint64_t command, STWValue::Dictionary keys) {
    auto reply = STWDaemonProcess::send(client, command, std::move(keys));
    if (STWDictionaryUInt64(reply, "ReplyError").value_or(0) != STWErrorSuccess)
        die("command " + std::to_string(command) + " failed");
    return reply;
}

// `du -s -B1 directory`, its output discarded; the run's time.
double timeDu(const fs::path& directory) {
    auto before = Clock::now();
    pid_t pid = fork();
    if (pid == 0) {
        int null = open("/dev/null", O_WRONLY);
        dup2(null, STDOUT_FILENO);
        execlp("du", "du", "-s", "-B1", directory.c_str(), nullptr);
        _exit(127);
    }
    int status = 0;
    waitpid(pid, &status, 0);
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0)
        die("du failed");
    return micros(Clock::now() - before);
}

uint64_t duBytes(const fs::path& directory) {
    std::string command = "du -s -B1 '" + directory.string() + "'";
    FILE* pipe = popen(command.c_str(), "r");
    unsigned long long bytes = 0;
    if (!pipe || fscanf(pipe, "%llu", &bytes) != 1)
        die("du failed");
    pclose(pipe);
    return bytes;
}

// The direct write of a metadata file of `contents` as `name` in `directoryfd`.
double timeDirectWrite(int directoryfd, const std::string& name, const std::string& contents) {
    auto before = Clock::now();
    std::string temporary = name + ".tmp";
    int fd = openat(directoryfd, temporary.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    bool ok = fd >= 0 && STWWriteAll(fd, contents) == 0 && fsync(fd) == 0;
    if (fd >= 0)
        close(fd);
    ok = ok && renameat(directoryfd, temporary.c_str(), directoryfd, name.c_str()) == 0 && fsync(directoryfd) == 0;
    if (!ok)
        die("direct metadata write failed");
    return micros(Clock::now() - before);
}

void run(bool quick) {
    STWDaemonProcess daemon({{"DeveloperMode", STWValue(true)}}, {}, false);
    // Its system log goes to a file, as on a device, not to this terminal.
    daemon.setStandardErrorFile(daemon.root() / "stowlyd.stderr");
    if (!daemon.start())
        die("stowlyd did not start");
    auto client = daemon.connectAs("com.example.bench", {{"com.vorlane.private.Stowly.allowed", STWValue(true)}});
    if (!client)
        die("cannot connect to stowlyd");
    auto created = checked(*client, 0,
                           {{"Identifier", STWValue("com.example.bench.du")},
                            {"ContainerClass", STWValue(2u)},
                            {"CreateIfNecessary", STWValue(true)}});
    fs::path container = *STWDictionaryString(created, "ReplyPath");
    STWValue::Dictionary identity{{"Identifier", STWValue("com.example.bench.du")},
                                  {"ContainerClass", STWValue(2u)},
                                  {"UUID", created["ReplyUUID"]}};

    // (a) 10,000 small files in 100 directories.
    const std::string text(300, 'x');
    for (int d = 0; d < 100; ++d) {
        fs::path directory = container / "Documents" / std::to_string(d);
        fs::create_directories(directory);
        for (int f = 0; f < 100; ++f)
            std::ofstream(directory / std::to_string(f)) << text;
    }
    const int rounds = quick ? 5 : 15;
    std::vector<double> daemonTimes, duTimes;
    uint64_t reported = 0;
    for (int i = 0; i < rounds + 1; ++i) {
        auto before = Clock::now();
        auto reply = checked(*client, 23, identity);
        double d = micros(Clock::now() - before);
        double b = timeDu(container);
        reported = STWDictionaryUInt64(reply, "ReplyDiskUsage").value_or(0);
        if (i == 0)
            continue; // both caches warm from here on
        daemonTimes.push_back(d);
        duTimes.push_back(b);
    }
    double d = median(daemonTimes), b = median(duTimes);
    printf("disk usage of 10,000 files: stowlyd %.1f ms (%llu bytes), du -s -B1 %.1f ms (%llu bytes)\n", d / 1e3,
           static_cast<unsigned long long>(reported), b / 1e3, static_cast<unsigned long long>(duBytes(container)));
    printf("disk_usage_10000_files: ratio %.2f (goal <= 1.2)\n", d / b);
    fflush(stdout);

    // (c) The daemon's metadata file as it is now, written directly beside the container.
    std::string contents;
    if (STWReadFileContents(container / ".com.vorlane.stowly.metadata.plist", &contents) != 0)
        die("cannot read the metadata file");
    fs::path direct = daemon.root() / "direct-metadata";
    fs::create_directories(direct);
    int directoryfd = open(direct.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    const int writes = quick ? 50 : 300;
    std::vector<double> setTimes, directTimes;
    for (int i = 0; i < writes; ++i) {
        STWValue::Dictionary keys = identity;
        keys["Key"] = STWValue("com.example.bench.counter");
        keys["Value"] = STWValue(static_cast<uint64_t>(i));
        auto before = Clock::now();
        checked(*client, 5, keys);
        setTimes.push_back(micros(Clock::now() - before));
        directTimes.push_back(timeDirectWrite(directoryfd, "metadata.plist", contents));
    }
    close(directoryfd);
    double s = median(setTimes), w = median(directTimes);
    printf("set info value: median stowlyd %.0f us, direct metadata write %.0f us\n", s, w);
    printf("set_info_value: ratio %.2f (goal <= 1.5)\n", s / w);
    fflush(stdout);
}

} // namespace

int main(int argc, char** argv) {
    bool quick = argc > 1 && strcmp(argv[1], "--quick") == 0;
    STWLog::setSystemLogLevel(STWLogLevel::Error);
    static bool daemonFailed = false;
    STWDaemonProcess::setFailureHandler([](const std::string& message) {
        fprintf(stderr, "stowly_bench_services: %s\n", message.c_str());
        daemonFailed = true;
    });
    try {
        run(quick);
    } catch (const std::exception& e) {
        fprintf(stderr, "stowly_bench_services: %s\n", e.what());
        return 1;
    }
    return daemonFailed ? 1 : 0;
}

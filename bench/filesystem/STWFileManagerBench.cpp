// Tree removal and disk usage against the tools an administrator would use for the same
// job (rm -rf, du -s), on the same tree shape, measured in the same run.
//
//   stowly_bench_filesystem [--quick]

#include "Daemon/FileSystem/STWFileManager.h"
#include "common/STWLog.h"

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <linux/magic.h>
#include <filesystem>
#include <spawn.h>
#include <string>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

extern char** environ;

namespace fs = std::filesystem;

namespace {

using Clock = std::chrono::steady_clock;

// 10 x 10 directories of 100 files each: 10,000 small files, the shape of a container's
// caches.
constexpr int kTop = 10, kMiddle = 10, kFiles = 100;

void buildTree(const fs::path& root) {
    fs::create_directories(root);
    std::string contents(200, 'c');
    for (int t = 0; t < kTop; ++t) {
        for (int m = 0; m < kMiddle; ++m) {
            fs::path dir = root / ("top" + std::to_string(t)) / ("mid" + std::to_string(m));
            fs::create_directories(dir);
            for (int f = 0; f < kFiles; ++f) {
                std::string name = (dir / ("file" + std::to_string(f) + ".cache")).native();
                int fd = open(name.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
                if (fd < 0 || write(fd, contents.data(), contents.size()) != static_cast<ssize_t>(contents.size())) {
                    fprintf(stderr, "cannot build %s: %s\n", name.c_str(), strerror(errno));
                    exit(2);
                }
                close(fd);
            }
        }
    }
}

// Runs a command and answers its wall time in seconds; its standard output goes to
// `output` when given.
double runCommand(const std::vector<std::string>& arguments, std::string* output = nullptr) {
    std::vector<char*> argv;
    for (const std::string& argument : arguments)
        argv.push_back(const_cast<char*>(argument.c_str()));
    argv.push_back(nullptr);
    int pipeFds[2] = {-1, -1};
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    if (output) {
        if (pipe2(pipeFds, O_CLOEXEC) != 0)
            exit(2);
        posix_spawn_file_actions_adddup2(&actions, pipeFds[1], STDOUT_FILENO);
    }
    auto start = Clock::now();
    pid_t pid;
    if (posix_spawnp(&pid, argv[0], &actions, nullptr, argv.data(), environ) != 0) {
        fprintf(stderr, "cannot run %s\n", argv[0]);
        exit(2);
    }
    if (output) {
        close(pipeFds[1]);
        char buffer[256];
        ssize_t n;
        while ((n = read(pipeFds[0], buffer, sizeof buffer)) > 0)
            output->append(buffer, static_cast<size_t>(n));
        close(pipeFds[0]);
    }
    int status = 0;
    waitpid(pid, &status, 0);
    double seconds = std::chrono::duration<double>(Clock::now() - start).count();
    posix_spawn_file_actions_destroy(&actions);
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) {
        fprintf(stderr, "%s failed\n", argv[0]);
        exit(2);
    }
    return seconds;
}

template <class F>
double timed(F&& body) {
    auto start = Clock::now();
    body();
    return std::chrono::duration<double>(Clock::now() - start).count();
}

double median(std::vector<double> values) {
    std::sort(values.begin(), values.end());
    return values[values.size() / 2];
}

void report(const char* name, double ours, double baseline, double goal, const char* baselineName, size_t runs) {
    printf("%s: ratio %.2f (goal <= %.1f)\n", name, ours / baseline, goal);
    printf("  stowly %.2f ms, %s %.2f ms (median of %zu runs, %d files)\n", ours * 1e3, baselineName,
           baseline * 1e3, runs, kTop * kMiddle * kFiles);
}

// Where the trees go: $STOWLY_BENCH_DIR when set, else a tmpfs when there is one. On a
// tmpfs nothing waits for the device, so the ratios show what each tool itself does; on
// a disk the device's time is added to both sides (and on virtual disks that discard
// freed blocks it swamps everything else). The trees are not synced before they are
// removed, for the same reason.
std::string scratchParent() {
    if (const char* dir = getenv("STOWLY_BENCH_DIR"); dir && *dir)
        return dir;
    struct statfs st;
    if (statfs("/dev/shm", &st) == 0 && st.f_type == TMPFS_MAGIC && access("/dev/shm", W_OK) == 0)
        return "/dev/shm";
    const char* tmp = getenv("TMPDIR");
    return tmp && *tmp ? tmp : "/tmp";
}

std::string fileSystemName(const std::string& path) {
    struct statfs st;
    if (statfs(path.c_str(), &st) != 0)
        return "unknown file system";
    switch (st.f_type) {
    case TMPFS_MAGIC:
        return "tmpfs";
    case EXT4_SUPER_MAGIC:
        return "ext4";
    case XFS_SUPER_MAGIC:
        return "xfs";
    case BTRFS_SUPER_MAGIC:
        return "btrfs";
    default:
        char name[32];
        snprintf(name, sizeof name, "file system 0x%llx", static_cast<unsigned long long>(st.f_type));
        return name;
    }
}

} // namespace

int main(int argc, char** argv) {
    bool quick = argc > 1 && strcmp(argv[1], "--quick") == 0;
    STWLog::setSystemLogLevel(STWLogLevel::Fault);
    std::string parent = scratchParent();
    std::string templ = parent + "/stowly-bench-fs-XXXXXX";
    if (!mkdtemp(templ.data())) {
        perror("mkdtemp");
        return 2;
    }
    fs::path scratch = templ;
    printf("trees in %s (%s)\n", parent.c_str(), fileSystemName(parent).c_str());
    STWFileManager* manager = STWFileManager::defaultManager();

    // Removal: each run builds two identical trees and removes one each way, alternating
    // which goes first so that neither always meets the colder cache.
    size_t removalRuns = quick ? 3 : 9;
    std::vector<double> ours, rm;
    for (size_t run = 0; run < removalRuns; ++run) {
        fs::path a = scratch / "remove-a", b = scratch / "remove-b";
        buildTree(a);
        buildTree(b);
        auto removeOurs = [&] {
            ours.push_back(timed([&] {
                if (!manager->removeItemAtURL(a)) {
                    fprintf(stderr, "removal failed\n");
                    exit(2);
                }
            }));
        };
        auto removeRm = [&] { rm.push_back(runCommand({"rm", "-rf", b.native()})); };
        if (run % 2) {
            removeOurs();
            removeRm();
        } else {
            removeRm();
            removeOurs();
        }
        if (fs::exists(a) || fs::exists(b)) {
            fprintf(stderr, "a tree survived its removal\n");
            return 2;
        }
    }
    report("fs_remove_tree", median(ours), median(rm), 1.2, "rm -rf", removalRuns);

    // Disk usage over one warm tree.
    fs::path tree = scratch / "usage";
    buildTree(tree);
    size_t usageRuns = quick ? 5 : 21;
    std::vector<double> oursUsage, du;
    uint64_t bytes = 0;
    std::string duOutput;
    runCommand({"du", "-s", "--block-size=1", tree.native()}, &duOutput);
    for (size_t run = 0; run < usageRuns; ++run) {
        auto measureOurs = [&] { oursUsage.push_back(timed([&] { bytes = manager->diskUsageForURL(tree); })); };
        auto measureDu = [&] {
            duOutput.clear();
            du.push_back(runCommand({"du", "-s", "--block-size=1", tree.native()}, &duOutput));
        };
        if (run % 2) {
            measureOurs();
            measureDu();
        } else {
            measureDu();
            measureOurs();
        }
    }
    report("fs_disk_usage", median(oursUsage), median(du), 1.2, "du -s", usageRuns);
    unsigned long long duBytes = strtoull(duOutput.c_str(), nullptr, 10);
    printf("  bytes: stowly %llu, du %llu%s\n", static_cast<unsigned long long>(bytes), duBytes,
           bytes == duBytes ? "" : " (MISMATCH)");

    manager->removeItemAtURL(scratch);
    return bytes == duBytes ? 0 : 1;
}

// Tree removal and disk usage against the tools an administrator would use for the same
// job (rm -rf, du -s), on the same tree shape, measured in the same run.
//
//   stowly_bench_filesystem [--quick]

#include "Daemon/FileSystem/STWFileManager.h"
#include "bench/support/STWBenchSupport.h"
#include "common/STWLog.h"

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

using namespace STWBench;

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

void report(const char* name, double ours, double baseline, double goal, const char* baselineName, size_t runs) {
    printf("%s: ratio %.2f (goal <= %.1f)\n", name, ours / baseline, goal);
    printf("  stowly %.2f ms, %s %.2f ms (median of %zu runs, %d files)\n", ours * 1e3, baselineName,
           baseline * 1e3, runs, kTreeFiles);
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
    // The trees are not synced before they are removed: on a disk the device's time would
    // swamp what each tool itself does.
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

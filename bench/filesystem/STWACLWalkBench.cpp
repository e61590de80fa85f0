// The system-container ACL walk against a bare nftw walk that makes the same chmod, chown
// and acl_set_file calls by path, over the same tree of 10,000 files, in the same run.
// The difference is what walking by descriptors (and opening each file to act on it)
// costs.
//
//   stowly_bench_acl [--quick]

#include "Daemon/FileSystem/STWFileManager.h"
#include "bench/support/STWBenchSupport.h"
#include "common/STWLog.h"
#include "platform/STWPlatformConfiguration.h"

#include <acl/libacl.h>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <ftw.h>
#include <string>
#include <sys/acl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

namespace fs = std::filesystem;

namespace {

using namespace STWBench;

constexpr gid_t kSystemUsers = 950;
constexpr uid_t kNobody = 65534;

// The baseline's ACLs, the same entries the daemon writes.
acl_t itemACL, topLevelACL;

int bareVisit(const char* path, const struct stat* st, int, FTW* ftw) {
    bool failed = false;
    if (ftw->level == 0) {
        failed = acl_set_file(path, ACL_TYPE_ACCESS, topLevelACL) != 0 ||
                 acl_set_file(path, ACL_TYPE_DEFAULT, itemACL) != 0;
    } else {
        failed = chmod(path, 0) != 0 || chown(path, kNobody, kNobody) != 0 ||
                 acl_set_file(path, ACL_TYPE_ACCESS, itemACL) != 0 ||
                 (S_ISDIR(st->st_mode) && acl_set_file(path, ACL_TYPE_DEFAULT, itemACL) != 0);
    }
    if (failed) {
        fprintf(stderr, "baseline failed on %s: %s\n", path, strerror(errno));
        exit(2);
    }
    return 0;
}

} // namespace

int main(int argc, char** argv) {
    bool quick = argc > 1 && strcmp(argv[1], "--quick") == 0;
    STWLog::setSystemLogLevel(STWLogLevel::Fault);
    if (geteuid() != 0) {
        printf("acl_walk: skipped, the walk changes owners and needs root\n");
        return 0;
    }
    std::string parent = scratchParent();
    std::string templ = parent + "/stowly-bench-acl-XXXXXX";
    if (!mkdtemp(templ.data())) {
        perror("mkdtemp");
        return 2;
    }
    fs::path scratch = templ;
    STWFileManager* manager = STWFileManager::defaultManager();
    // A private root whose group database has "systemusers", so the machine's is untouched.
    fs::create_directories(scratch / "root/etc/stowly");
    std::ofstream(scratch / "root/etc/group") << "root:x:0:\nsystemusers:x:" << kSystemUsers << ":\n";
    std::ofstream(scratch / "root/etc/passwd") << "root:x:0:0:root:/root:/bin/sh\n";
    STWErrorRef error;
    auto configuration = STWPlatformConfiguration::loadFromRoot(scratch / "root", &error);
    if (!configuration) {
        fprintf(stderr, "cannot load the private root: %s\n", error ? error->description().c_str() : "");
        return 2;
    }
    STWPlatformConfiguration::setSharedInstance(configuration);

    fs::path ours = scratch / "ours", bare = scratch / "bare";
    buildTree(ours);
    buildTree(bare);
    fs::permissions(ours, fs::perms(0755));
    fs::permissions(bare, fs::perms(0755));
    std::string groupEntry = "g:" + std::to_string(kSystemUsers);
    itemACL = acl_from_text(("u::---,g::---,o::---,m::rwx," + groupEntry + ":rwx").c_str());
    topLevelACL = acl_from_text(("u::rwx,g::r-x,o::r-x,m::rwx," + groupEntry + ":-wx").c_str());
    if (!itemACL || !topLevelACL) {
        fprintf(stderr, "cannot build the baseline's ACLs\n");
        return 2;
    }
    // Probe: a file system without POSIX ACLs has nothing to measure.
    if (acl_set_file(bare.c_str(), ACL_TYPE_ACCESS, topLevelACL) != 0) {
        printf("acl_walk: skipped, %s has no POSIX ACLs: %s\n", parent.c_str(), strerror(errno));
        manager->removeItemAtURL(scratch);
        return 0;
    }

    // Alternating which goes first, each over its own warm tree; every run repeats every
    // call on both sides.
    size_t runs = quick ? 3 : 11;
    std::vector<double> oursTimes, bareTimes;
    for (size_t run = 0; run < runs; ++run) {
        auto measureOurs = [&] {
            oursTimes.push_back(timed([&] {
                if (!manager->standardizeACLsForSystemContainerAtURL(ours)) {
                    fprintf(stderr, "the walk failed\n");
                    exit(2);
                }
            }));
        };
        auto measureBare = [&] {
            bareTimes.push_back(timed([&] { nftw(bare.c_str(), bareVisit, 64, FTW_PHYS | FTW_MOUNT); }));
        };
        if (run % 2) {
            measureOurs();
            measureBare();
        } else {
            measureBare();
            measureOurs();
        }
    }
    double ratio = median(oursTimes) / median(bareTimes);
    printf("acl_walk: ratio %.2f (goal <= 1.2)\n", ratio);
    printf("  stowly %.2f ms, nftw with chmod, chown, acl_set_file %.2f ms (median of %zu runs, %d files)\n",
           median(oursTimes) * 1e3, median(bareTimes) * 1e3, runs, kTreeFiles);

    // Both sides must have done the same work.
    fs::path sample = "top3/mid4/file5.cache";
    struct stat a, b;
    bool same = lstat((ours / sample).c_str(), &a) == 0 && lstat((bare / sample).c_str(), &b) == 0 &&
                a.st_mode == b.st_mode && a.st_uid == b.st_uid && a.st_gid == b.st_gid;
    if (!same)
        printf("  the two trees differ after the walks (MISMATCH)\n");
    acl_free(itemACL);
    acl_free(topLevelACL);
    manager->removeItemAtURL(scratch);
    return same ? 0 : 1;
}

// A protection-class change over a container of 10,000 files against a bare walk (nftw)
// that reads and sets the protection-class attribute of the same items by path, measured
// in the same run. The change pays for what the bare walk skips: the update file, the
// look-up, and opening every item from its parent without following links.
//
//   stowly_bench_dataprotection [--quick]

#include "Daemon/DataProtection/STWDataProtectionChangeOperation.h"
#include "Daemon/DataProtection/STWDataProtectionManager.h"
#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "Daemon/Request/STWClientConnection.h"
#include "bench/support/STWBenchSupport.h"
#include "common/STWLog.h"
#include "platform/STWPlatformConfiguration.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <ftw.h>
#include <string>
#include <sys/xattr.h>
#include <unistd.h>
#include <vector>

namespace fs = std::filesystem;

namespace {

using namespace STWBench;

constexpr const char* kAttribute = "trusted.stowly.protection-class";

// The 10,000-file tree with empty files named fileF, every one at `protectionClass`.
void buildTree(const fs::path& root, int32_t protectionClass) {
    STWBench::buildTree(root, {.suffix = "",
                               .bytes = 0,
                               .attribute = kAttribute,
                               .attributeValue = std::string(reinterpret_cast<const char*>(&protectionClass),
                                                             sizeof protectionClass)});
}

int32_t bareTarget;
size_t bareItems;
int bareVisit(const char* path, const struct stat*, int type, struct FTW*) {
    if (type != FTW_F && type != FTW_DP)
        return 0;
    int32_t current = 0;
    if (lgetxattr(path, kAttribute, &current, sizeof current) < 0 && errno != ENODATA)
        return -1;
    if (current != bareTarget && lsetxattr(path, kAttribute, &bareTarget, sizeof bareTarget, 0) != 0)
        return -1;
    ++bareItems;
    return 0;
}

// A root prefix of the benchmark's own, with the mobile user, on a tmpfs when there is one
// (or $STOWLY_BENCH_DIR): nothing waits for a device, so the ratio shows what each walk
// itself does.
fs::path makeRoot() {
    std::string templ = scratchParent(DiskFallback::tmp) + "/stowly-bench-dp-XXXXXX";
    if (!mkdtemp(templ.data())) {
        perror("mkdtemp");
        exit(2);
    }
    fs::path root = templ;
    fs::permissions(root, fs::perms(0755));
    fs::create_directories(root / "etc/stowly");
    std::ofstream(root / "etc/passwd") << "root:x:0:0:root:/private/var/root:/bin/sh\n"
                                          "mobile:x:501:501:Mobile:/private/var/mobile:/bin/sh\n";
    std::ofstream(root / "etc/group") << "root:x:0:\nmobile:x:501:\n";
    STWErrorRef error;
    auto configuration = STWPlatformConfiguration::loadFromRoot(root, &error);
    if (!configuration)
        exit(2);
    STWPlatformConfiguration::setSharedInstance(configuration);
    return root;
}

} // namespace

int main(int argc, char** argv) {
    bool quick = argc > 1 && strcmp(argv[1], "--quick") == 0;
    STWLog::setSystemLogLevel(STWLogLevel::Fault);
    fs::path root = makeRoot();
    auto identity = STWContainerIdentity::containerIdentityWithUserIdentity(STWUserIdentityCache::defaultUserIdentity(),
                                                                           "com.example.bench", 2, nullptr);
    uint64_t code = STWErrorSuccess;
    auto container = STWClientConnection::sharedClientConnection()->createOrLookupContainerWithContainerIdentity(
        identity, true, false, true, &code);
    if (!container) {
        fprintf(stderr, "cannot create the container: %llu\n", static_cast<unsigned long long>(code));
        return 2;
    }
    fs::path ours = container->url() / "Documents", bare = root / "bare";
    buildTree(ours, 3);
    buildTree(bare, 3);

    // Each run moves both trees to the other class, every item read and rewritten; the side
    // that goes first alternates.
    auto queue = STWDataProtectionManager::defaultManager()->protectionOperationFileQueue();
    size_t runs = quick ? 3 : 9;
    std::vector<double> change, walk;
    for (size_t run = 0; run < runs; ++run) {
        int32_t target = run % 2 ? 3 : 1;
        auto runChange = [&] {
            auto operation = STWDataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
                container, target, false, STWDataProtectionChangeDirectories | STWDataProtectionChangeFiles, queue);
            STWErrorRef error;
            change.push_back(timed([&] {
                if (!operation->writeToDiskWithError(&error))
                    exit(2);
                operation->setCompletionBlock([&](bool, const STWErrorRef& e) { error = e; });
                operation->performChangeOperation();
            }));
            if (error) {
                fprintf(stderr, "the change failed: %s\n", error->description().c_str());
                exit(2);
            }
        };
        auto runWalk = [&] {
            bareTarget = target;
            bareItems = 0;
            walk.push_back(timed([&] {
                if (nftw(bare.c_str(), bareVisit, 64, FTW_PHYS | FTW_DEPTH | FTW_MOUNT) != 0)
                    exit(2);
            }));
        };
        if (run % 2) {
            runChange();
            runWalk();
        } else {
            runWalk();
            runChange();
        }
        int32_t sample = 0;
        if (getxattr((ours / "top9/mid9/file99").c_str(), kAttribute, &sample, sizeof sample) != sizeof sample ||
            sample != target) {
            fprintf(stderr, "the change left a file at class %d, not %d\n", sample, target);
            return 2;
        }
    }
    printf("dp_change_10k_files: ratio %.2f (goal <= 1.2)\n", median(change) / median(walk));
    printf("  change %.2f ms, bare walk %.2f ms (median of %zu runs, %zu items)\n", median(change) * 1e3,
           median(walk) * 1e3, runs, bareItems);
    STWFileManager::defaultManager()->removeItemAtURL(root);
    return 0;
}

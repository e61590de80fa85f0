// The small helpers the benchmarks share: timing a call, the middle and the percentiles of
// a series, where scratch trees go, and the tree of 10,000 small files the file-layer
// benchmarks measure on. Header-only, so each benchmark stays one executable of its own.
#pragma once

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <linux/magic.h>
#include <string>
#include <sys/statfs.h>
#include <sys/types.h>
#include <sys/xattr.h>
#include <unistd.h>
#include <vector>

namespace STWBench {

using Clock = std::chrono::steady_clock;

// Seconds that `body` took.
template <class F>
double timed(F&& body) {
    auto start = Clock::now();
    body();
    return std::chrono::duration<double>(Clock::now() - start).count();
}

// The value at fraction `p` of the sorted series (nearest rank, rounding up), 0 for none.
inline double percentile(std::vector<double> values, double p) {
    if (values.empty())
        return 0;
    std::sort(values.begin(), values.end());
    return values[std::min(values.size() - 1, static_cast<size_t>(p * static_cast<double>(values.size())))];
}

// What median() answers for an even count: the upper of the two middle values (as
// percentile(values, 0.5) does), or their mean.
enum class EvenMiddle { upper, mean };

// The middle of the series, 0 for none.
inline double median(std::vector<double> values, EvenMiddle even = EvenMiddle::upper) {
    if (values.empty())
        return 0;
    std::sort(values.begin(), values.end());
    size_t n = values.size();
    if (n % 2 == 0 && even == EvenMiddle::mean)
        return (values[n / 2 - 1] + values[n / 2]) / 2;
    return values[n / 2];
}

// Where scratchParent() goes when there is no writable tmpfs.
enum class DiskFallback { tmpdirOrTmp, tmp };

// Where scratch trees go: $STOWLY_BENCH_DIR when set, else /dev/shm when it is a writable
// tmpfs, else the disk. On a tmpfs nothing waits for the device, so a ratio shows what each
// side itself does; on a disk the device's time is added to both sides (and on virtual
// disks that discard freed blocks it swamps everything else).
inline std::string scratchParent(DiskFallback fallback = DiskFallback::tmpdirOrTmp) {
    if (const char* dir = getenv("STOWLY_BENCH_DIR"); dir && *dir)
        return dir;
    struct statfs st;
    if (statfs("/dev/shm", &st) == 0 && st.f_type == TMPFS_MAGIC && access("/dev/shm", W_OK) == 0)
        return "/dev/shm";
    if (fallback == DiskFallback::tmp)
        return "/tmp";
    const char* tmp = getenv("TMPDIR");
    return tmp && *tmp ? tmp : "/tmp";
}

// The tree's shape: 10 x 10 directories of 100 files each, 10,000 small files, the shape of
// a container's caches.
constexpr int kTreeTop = 10, kTreeMiddle = 10, kTreeFilesPerDirectory = 100;
constexpr int kTreeFiles = kTreeTop * kTreeMiddle * kTreeFilesPerDirectory;

// What each file of the tree is. The defaults are cache files of 200 bytes.
struct TreeFiles {
    std::string suffix = ".cache";
    size_t bytes = 200;
    // An extended attribute set on every file when named, with these bytes as its value.
    std::string attribute;
    std::string attributeValue;
};

// Builds the tree under `root` (made when missing) as topT/midM/fileF<suffix>. A file that
// cannot be made ends the process with status 2.
inline void buildTree(const std::filesystem::path& root, const TreeFiles& files = {}) {
    std::filesystem::create_directories(root);
    std::string contents(files.bytes, 'c');
    for (int t = 0; t < kTreeTop; ++t) {
        for (int m = 0; m < kTreeMiddle; ++m) {
            std::filesystem::path dir = root / ("top" + std::to_string(t)) / ("mid" + std::to_string(m));
            std::filesystem::create_directories(dir);
            for (int f = 0; f < kTreeFilesPerDirectory; ++f) {
                std::string name = (dir / ("file" + std::to_string(f) + files.suffix)).native();
                int fd = open(name.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
                bool made = fd >= 0 &&
                            (contents.empty() ||
                             write(fd, contents.data(), contents.size()) == static_cast<ssize_t>(contents.size())) &&
                            (files.attribute.empty() || fsetxattr(fd, files.attribute.c_str(), files.attributeValue.data(),
                                                                  files.attributeValue.size(), 0) == 0);
                if (!made) {
                    fprintf(stderr, "cannot build %s: %s\n", name.c_str(), strerror(errno));
                    exit(2);
                }
                close(fd);
            }
        }
    }
}

} // namespace STWBench

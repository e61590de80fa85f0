// Reading metadata files with full validation, against reading and parsing the same files
// with libplist alone. Prints "metadata_read_validate: ratio X (goal <= 1.3)".
//
// Usage: stowly_bench_model [--quick]
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Model/STWMetadata.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWFileIO.h"
#include "common/STWLog.h"
#include "platform/STWPlatformConfiguration.h"

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <plist/plist.h>
#include <vector>

namespace {

using Clock = std::chrono::steady_clock;

double seconds(Clock::duration d) { return std::chrono::duration<double>(d).count(); }

} // namespace

int main(int argc, char** argv) {
    bool quick = argc > 1 && strcmp(argv[1], "--quick") == 0;
    // Creating the files is what takes long on a busy disk; the quick run makes fewer.
    const int count = quick ? 3000 : 10000;
    const int rounds = quick ? 3 : 5;
    const size_t slice = 100;
    const int turns = 4;
    STWLog::setSystemLogLevel(STWLogLevel::Error);

    char templ[] = "/tmp/stowly-bench-metadata-XXXXXX";
    if (!mkdtemp(templ))
        return 1;
    std::filesystem::path root = templ;
    std::filesystem::create_directories(root / "etc/stowly");
    std::filesystem::create_directories(root / "private/var/mobile");
    std::ofstream(root / "etc/passwd") << "mobile:x:501:501:Mobile:/private/var/mobile:/bin/sh\n";
    STWErrorRef error;
    STWPlatformConfiguration::setSharedInstance(STWPlatformConfiguration::loadFromRoot(root, &error));

    auto mobile = STWUserIdentitySharedCache::sharedInstance()->userIdentityForPersonalPersona();
    auto classDirectory = *STWGlobalConfiguration::sharedInstance()->containerDirectoryURLForUserIdentity(mobile, 2, false);
    // Every file holds what the writer produces. Only a sample goes through the durable
    // write itself: three syncs per file would make the setup, not the reads, the cost of
    // the run. The others get the same dictionary written without syncing.
    std::vector<std::filesystem::path> containers;
    for (int i = 0; i < count; ++i) {
        STWUUID uuid = STWUUID::random();
        auto container = classDirectory / uuid.string();
        std::filesystem::create_directory(container);
        auto identity = STWConcreteContainerIdentity::containerIdentityWithUUID(
            uuid, mobile, "com.example.app" + std::to_string(i), 2, nullptr);
        STWMetadata metadata(identity, STWValue::Dictionary{{STWMetadata::contentProtectionClassInfoKey, STWValue(3)}},
                             container, std::nullopt);
        bool written = i % 500 == 0 ? metadata.writeMetadataToDiskWithError(&error)
                                    : STW_writeToURL(metadata.dictionaryRepresentation(),
                                                     container / STWMetadata::fileName, STWWriteDefault, &error);
        if (!written) {
            fprintf(stderr, "could not write metadata: %s\n", error->message().c_str());
            return 1;
        }
        containers.push_back(container);
    }

    // The machine is shared (and its page cache with it), so a figure over the whole set
    // would mostly measure the neighbours. Each slice of files is first read once untimed,
    // then read by both sides in turns, changing which goes first; a side's time for the
    // slice is its fastest turn, and the figure is the median of the per-slice ratios.
    auto bare = [&](const std::filesystem::path& container) {
        std::string bytes;
        if (STWReadFileContents(container / STWMetadata::fileName, &bytes, STWReadNoFollow) != 0)
            return false;
        plist_t p = nullptr;
        plist_from_memory(bytes.data(), static_cast<uint32_t>(bytes.size()), &p);
        bool parsed = p != nullptr;
        plist_free(p);
        return parsed;
    };
    // As the container cache reads a class: beneath the class directory's descriptor.
    STWFileDescriptor classfd = STWFileManager::defaultManager()->openDirectoryAtURL(classDirectory);
    auto validated = [&](const std::filesystem::path& container) {
        return STWMetadata::readAndValidateMetadataInDirectory(classfd.get(), container.filename(), container, mobile,
                                                               true, nullptr) != nullptr;
    };
    auto timedSlice = [&](size_t first, size_t last, auto&& read) {
        auto start = Clock::now();
        for (size_t i = first; i < last; ++i) {
            if (!read(containers[i])) {
                fprintf(stderr, "could not read %s\n", containers[i].c_str());
                exit(1);
            }
        }
        return seconds(Clock::now() - start);
    };
    std::vector<double> ratios;
    double totalValidated = 0, totalBare = 0;
    for (int round = 0; round < rounds; ++round) {
        for (size_t first = 0; first < containers.size(); first += slice) {
            size_t last = std::min(first + slice, containers.size());
            timedSlice(first, last, bare);
            double b = 1e9, v = 1e9;
            for (int turn = 0; turn < turns; ++turn) {
                if (turn % 2 == 0) {
                    b = std::min(b, timedSlice(first, last, bare));
                    v = std::min(v, timedSlice(first, last, validated));
                } else {
                    v = std::min(v, timedSlice(first, last, validated));
                    b = std::min(b, timedSlice(first, last, bare));
                }
            }
            ratios.push_back(v / b);
            totalValidated += v;
            totalBare += b;
        }
    }
    // What was timed must be what was written, or the comparison means nothing.
    for (size_t i = 0; i < containers.size(); i += 97) {
        auto read = STWMetadata::readAndValidateMetadataAtUrl(containers[i], mobile, true, nullptr);
        if (!read || read->identifier() != "com.example.app" + std::to_string(i) ||
            read->uuid().string() != containers[i].filename().string() || read->url() != containers[i]) {
            fprintf(stderr, "metadata of %s read back wrong\n", containers[i].c_str());
            return 1;
        }
    }
    std::sort(ratios.begin(), ratios.end());
    double median = ratios.size() % 2 ? ratios[ratios.size() / 2]
                                      : (ratios[ratios.size() / 2 - 1] + ratios[ratios.size() / 2]) / 2;
    double reads = rounds * static_cast<double>(containers.size());
    printf("  metadata files: %zu x %d rounds in slices of %zu, best of %d turns; validated read %.1f us/file, bare "
           "parse %.1f us/file\n",
           containers.size(), rounds, slice, turns, totalValidated / reads * 1e6, totalBare / reads * 1e6);
    printf("metadata_read_validate: ratio %.2f (goal <= 1.3)\n", median);
    STWFileManager::defaultManager()->removeItemAtURL(root);
    return 0;
}

// Reading metadata files with full validation, against reading and parsing the same files
// with libplist alone. Prints "metadata_read_validate: ratio X (goal <= 1.3)".
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWMetadata.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
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
    const int count = 10000;
    const int rounds = quick ? 3 : 7;
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
    std::vector<std::filesystem::path> containers;
    for (int i = 0; i < count; ++i) {
        STWUUID uuid = STWUUID::random();
        auto container = classDirectory / uuid.string();
        std::filesystem::create_directory(container);
        auto identity = STWConcreteContainerIdentity::containerIdentityWithUUID(
            uuid, mobile, "com.example.app" + std::to_string(i), 2, nullptr);
        STWMetadata metadata(identity, STWValue::Dictionary{{"com.vorlane.Setwright.ContentProtectionClass", STWValue(3)}},
                             container, std::nullopt);
        if (!metadata.writeMetadataToDiskWithError(&error)) {
            fprintf(stderr, "could not write metadata: %s\n", error->message().c_str());
            return 1;
        }
        containers.push_back(container);
    }

    double best = 1e9, bestBaseline = 1e9;
    size_t valid = 0;
    for (int round = 0; round < rounds; ++round) {
        auto start = Clock::now();
        size_t parsed = 0;
        for (const auto& container : containers) {
            std::string bytes;
            if (STWReadFileContents(container / STWMetadata::fileName, &bytes, STWReadNoFollow) != 0)
                continue;
            plist_t p = nullptr;
            plist_from_memory(bytes.data(), static_cast<uint32_t>(bytes.size()), &p);
            parsed += p != nullptr;
            plist_free(p);
        }
        bestBaseline = std::min(bestBaseline, seconds(Clock::now() - start));

        start = Clock::now();
        valid = 0;
        for (const auto& container : containers)
            valid += STWMetadata::readAndValidateMetadataAtUrl(container, mobile, true, nullptr) != nullptr;
        best = std::min(best, seconds(Clock::now() - start));
        if (parsed != containers.size() || valid != containers.size()) {
            fprintf(stderr, "parsed %zu, validated %zu of %zu\n", parsed, valid, containers.size());
            return 1;
        }
    }
    printf("metadata files: %d, validated read %.1f us/file, bare parse %.1f us/file\n", count, best / count * 1e6,
           bestBaseline / count * 1e6);
    printf("metadata_read_validate: ratio %.2f (goal <= 1.3)\n", best / bestBaseline);
    std::filesystem::remove_all(root);
    return 0;
}

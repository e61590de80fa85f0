// The reader of protection-change update files, on whatever bytes the file holds: it never
// crashes, and what it accepts is a change it can act on (a class from 1 to 13, with a user
// identity exactly when the class needs one). The bytes go through a real file below a
// private root, as the daemon reads them at start.
#include "Daemon/DataProtection/STWDataProtectionChangeOperation.h"
#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Model/STWUserIdentity.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "common/STWFileIO.h"
#include "common/STWLog.h"
#include "platform/STWPlatformConfiguration.h"

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string_view>

namespace fs = std::filesystem;

namespace {

// A root of the fuzzer's own (the user database and persona list of the cache live there),
// removed when the process exits.
const fs::path& root() {
    static const fs::path path = [] {
        char templ[] = "/tmp/stowly-fuzz-root-XXXXXX";
        if (!mkdtemp(templ))
            abort();
        fs::path p = templ;
        fs::create_directories(p / "etc/stowly");
        std::ofstream(p / "etc/passwd") << "root:x:0:0:root:/private/var/root:/bin/sh\n"
                                           "mobile:x:501:501:Mobile:/private/var/mobile:/bin/sh\n";
        std::ofstream(p / "etc/group") << "root:x:0:\nmobile:x:501:\n";
        STWErrorRef error;
        auto configuration = STWPlatformConfiguration::loadFromRoot(p, &error);
        if (!configuration)
            abort();
        STWPlatformConfiguration::setSharedInstance(configuration);
        static fs::path cleanup = p;
        atexit([] { std::error_code ec; fs::remove_all(cleanup, ec); });
        return p;
    }();
    return path;
}

} // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    STWLog::setSystemLogLevel(STWLogLevel::Fault);
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    fs::path file = root() / "update.plist";
    if (STWWriteFileAtomically(file, std::string_view(reinterpret_cast<const char*>(data), size), 0644, false) != 0)
        abort();
    auto cache = STWUserIdentitySharedCache::sharedInstance();
    STWErrorRef error;
    auto info = STWDataProtectionChangeOperation::_readAndValidateDataProtectionUpdateAtURL(file, *cache, &error);
    if (!info) {
        if (!error || (error->code() != STWErrorReadFileFailed && error->code() != STWErrorInvalidContent))
            abort();
        return 0;
    }
    bool needsUser = STWUserIdentity::isUserIdentityRequiredForContainerClass(info->containerClass);
    if (info->containerClass < 1 || info->containerClass > 13 || needsUser != (info->userIdentity != nullptr)) {
        fprintf(stderr, "update fuzzer: accepted class %llu with%s user identity\n",
                static_cast<unsigned long long>(info->containerClass), info->userIdentity ? "" : "out");
        abort();
    }
    return 0;
}

// The reader of protection-change update files, on whatever bytes the file holds: it never
// crashes, and what it accepts is a change it can act on (a class from 1 to 13, with a user
// identity exactly when the class needs one). The bytes go through a real file below a
// private root, as the daemon reads them at start.
#include "Daemon/DataProtection/STWDataProtectionChangeOperation.h"
#include "Daemon/Model/STWUserIdentity.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "fuzz/STWFuzzRoot.h"

#include <cstdio>
#include <cstdlib>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::filesystem::path file = STWFuzzRoot() / "update.plist";
    STWFuzzWriteInput(file, data, size);
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

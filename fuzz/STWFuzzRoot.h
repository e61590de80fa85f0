// The private root prefix of a fuzzer process: a directory of its own below $TMPDIR (or
// /tmp) with a user and group database, installed as the platform configuration in force,
// so that the daemon's readers find their files, users and layout there as they would
// below a real root. Made on first use and removed when the process exits normally;
// scripts/fuzz points TMPDIR at a directory of its own and removes that too, since
// libFuzzer leaves by _exit on a finding or a timeout, past every atexit handler.
#pragma once

#include "common/STWFileIO.h"
#include "platform/STWPlatformConfiguration.h"

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string_view>

inline const std::filesystem::path& STWFuzzRoot() {
    static const std::filesystem::path root = [] {
        const char* tmp = getenv("TMPDIR");
        std::string templ = std::string(tmp && *tmp ? tmp : "/tmp") + "/stowly-fuzz-root-XXXXXX";
        if (!mkdtemp(templ.data()))
            abort();
        std::filesystem::path p = templ;
        static std::filesystem::path cleanup = p;
        atexit([] {
            std::error_code ec;
            std::filesystem::remove_all(cleanup, ec);
        });
        std::filesystem::create_directories(p / "etc/stowly");
        std::ofstream(p / "etc/passwd") << "root:x:0:0:root:/private/var/root:/bin/sh\n"
                                           "mobile:x:501:501:Mobile:/private/var/mobile:/bin/sh\n";
        std::ofstream(p / "etc/group") << "root:x:0:\nmobile:x:501:\n";
        STWErrorRef error;
        auto configuration = STWPlatformConfiguration::loadFromRoot(p, &error);
        if (!configuration)
            abort();
        STWPlatformConfiguration::setSharedInstance(configuration);
        return p;
    }();
    return root;
}

// Writes a fuzz input to `file` (replacing what was there), as a reader would find it.
// Never synced: a sync per input would spend the run waiting for the disk.
inline void STWFuzzWriteInput(const std::filesystem::path& file, const uint8_t* data, size_t size) {
    if (STWWriteFile(file, std::string_view(reinterpret_cast<const char*>(data), size), 0644, false) != 0)
        abort();
}

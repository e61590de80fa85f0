// The client registry, on whatever bytes one of its files holds: the file is read as a
// reload reads the directory, and whatever entry it makes must be found again the way
// a connecting process is matched, by its executable's path (and digest, where the entry
// pins one) and by its signing identifier.
#include "common/STWDictionaryUtilities.h"
#include "common/STWFileDescriptor.h"
#include "fuzz/STWFuzzRoot.h"
#include "platform/STWClientRegistry.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>

namespace {

// The program a matched process runs. Its digest is what the seeds pin.
constexpr std::string_view kExecutableContent = "#!/bin/sh\nexit 0\n";

[[noreturn]] void fail(const std::string& what) {
    fprintf(stderr, "client registry fuzzer: %s\n", what.c_str());
    abort();
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static const std::filesystem::path directory = STWFuzzRoot() / "etc/stowly/clients.d";
    static STWClientRegistry registry = [] {
        std::filesystem::create_directories(directory);
        return STWClientRegistry(directory);
    }();
    static const STWFileDescriptor executable = [] {
        std::filesystem::path program = STWFuzzRoot() / "program";
        STWFuzzWriteInput(program, reinterpret_cast<const uint8_t*>(kExecutableContent.data()),
                          kExecutableContent.size());
        STWFileDescriptor fd(open(program.c_str(), O_RDONLY | O_CLOEXEC));
        if (!fd)
            abort();
        return fd;
    }();

    std::filesystem::path file = directory / "client.plist";
    STWFuzzWriteInput(file, data, size);
    registry.reload();

    // The entry the file makes, if any, read as the reload reads it.
    STWErrorRef readError;
    auto dictionary = STW_dictionaryWithContentsOfURL(file, STWReadNoFollow, &readError);
    std::string reason;
    std::optional<STWClientRegistryEntry> entry;
    if (dictionary)
        entry = STWClientRegistryEntry::fromDictionary(*dictionary, true, &reason);
    if (!entry)
        return 0;
    if (entry->codeSigningIdentifier.empty() || !entry->executable.is_absolute())
        fail("accepted an entry without identifier or absolute executable");
    if (entry->sha256 && (entry->sha256->size() != 64 ||
                          entry->sha256->find_first_not_of("0123456789abcdef") != std::string::npos))
        fail("accepted the digest " + *entry->sha256);

    STWErrorRef error;
    STWClientRegistryEntryRef found = registry.entryForExecutable(entry->executable, executable.get(), &error);
    if (found) {
        if (found->codeSigningIdentifier != entry->codeSigningIdentifier ||
            !found->entitlements.isIdenticalTo(entry->entitlements))
            fail("the executable " + entry->executable.native() + " matched another entry");
    } else if (!entry->sha256 || !error || !error->isPOSIX(EPERM)) {
        // Only a digest that the program does not have keeps a registered program out.
        fail("the executable " + entry->executable.native() + " was not matched: " + STWFormat("%@", error));
    }
    auto executables = registry.executablesForCodeSigningIdentifier(entry->codeSigningIdentifier);
    if (std::find(executables.begin(), executables.end(), entry->executable) == executables.end())
        fail("the identifier " + entry->codeSigningIdentifier + " does not list " + entry->executable.native());
    return 0;
}

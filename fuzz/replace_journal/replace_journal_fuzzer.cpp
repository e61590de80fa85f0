// The reader of replace journals, on whatever bytes a journal holds: a start trusts the
// four paths it returns enough to move a container from one to another, so every path it
// accepts is absolute, without a ".." component, and reads back the same once the daemon
// writes it into a journal of its own.
#include "Daemon/Request/STWClientConnection.h"
#include "common/STWDictionaryUtilities.h"
#include "fuzz/STWFuzzRoot.h"

#include <cstdio>
#include <cstdlib>

namespace {

bool isTrustedPath(const std::filesystem::path& path) {
    const std::string& text = path.native();
    return !text.empty() && text.front() == '/' && text.find('\0') == std::string::npos &&
           !containsDotDotPathComponents(text);
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::filesystem::path file = STWFuzzRoot() / "journal.plist";
    STWFuzzWriteInput(file, data, size);
    STWErrorRef error;
    auto info = STWClientConnection::_readAndValidateReplaceFileAtUrl(file, &error);
    if (!info) {
        // A file that is no dictionary is refused without an error; anything else names why.
        if (error && error->code() != STWErrorBadReplaceFile)
            abort();
        return 0;
    }
    for (const auto* path : {&info->oldURL, &info->newURL, &info->stagingURL, &info->destURL}) {
        if (!isTrustedPath(*path)) {
            fprintf(stderr, "replace journal fuzzer: accepted the path %s\n", path->c_str());
            abort();
        }
    }
    std::filesystem::path rewritten = STWFuzzRoot() / "rewritten.plist";
    STWErrorRef writeError;
    if (!STWClientConnection::_writeToDiskReplaceAt(rewritten, *info, &writeError))
        abort();
    STWErrorRef rereadError;
    auto reread = STWClientConnection::_readAndValidateReplaceFileAtUrl(rewritten, &rereadError);
    if (!reread || reread->oldURL != info->oldURL || reread->newURL != info->newURL ||
        reread->stagingURL != info->stagingURL || reread->destURL != info->destURL) {
        fprintf(stderr, "replace journal fuzzer: a journal written from %s, %s, %s, %s reads back otherwise\n",
                info->oldURL.c_str(), info->newURL.c_str(), info->stagingURL.c_str(), info->destURL.c_str());
        abort();
    }
    return 0;
}

// The readers of the device configuration, on whatever bytes the files hold: stowlyd.plist
// (the first byte even) or os-release (odd), the rest of the input being the file, loaded
// as a start loads them from a root of their own. A configuration either fails with the
// path of the file or holds only values the daemon can use; os-release gives only fields
// that survive being written out again.
#include "common/STWDictionaryUtilities.h"
#include "fuzz/STWFuzzRoot.h"
#include "platform/STWPlatformConfiguration.h"

#include <cstdio>
#include <cstdlib>

namespace {

const std::filesystem::path& configurationRoot() {
    static const std::filesystem::path root = [] {
        std::filesystem::path p = STWFuzzRoot() / "configuration";
        std::filesystem::create_directories(p / "etc/stowly");
        return p;
    }();
    return root;
}

[[noreturn]] void fail(const std::string& what) {
    fprintf(stderr, "configuration fuzzer: %s\n", what.c_str());
    abort();
}

void checkSettings(const STWPlatformConfiguration& configuration) {
    const STWClientBounds& bounds = configuration.clientBounds();
    if ((bounds.maxConnections && *bounds.maxConnections == 0) ||
        (bounds.maxConnectionsPerUser && *bounds.maxConnectionsPerUser == 0) || bounds.maxPendingFrameBytes == 0)
        fail("accepted a bound of 0");
    for (auto timeout : {bounds.firstFrameTimeout, bounds.frameTimeout})
        if (timeout.count() < 1 || timeout.count() > 1000000000)
            fail(STWFormat("accepted a timeout of %lld ms", static_cast<long long>(timeout.count())));
    if (configuration.mobileUserName().empty())
        fail("accepted an empty mobile user name");
    if (configuration.installationUID() == static_cast<uid_t>(-1) ||
        configuration.systemContainerUID() == static_cast<uid_t>(-1))
        fail("accepted the user id -1");
    if (const STWValue* features = STWDictionaryFind(configuration.settings(), "Features"))
        for (const auto& [name, value] : *features->dictionary())
            if (configuration.isFeatureEnabled(name) != value.boolValue().value())
                fail("feature " + name + " reads otherwise than the file has it");
}

// KEY="value" with the quotes and backslashes of the value escaped, as a build writes it.
std::string render(const STWValue::Dictionary& fields) {
    std::string text;
    for (const auto& [key, value] : fields) {
        text += key + "=\"";
        for (char c : *value.string()) {
            if (c == '"' || c == '\\')
                text += '\\';
            text += c;
        }
        text += "\"\n";
    }
    return text;
}

void checkOSRelease(std::string_view text) {
    STWValue::Dictionary fields = STWParseOSRelease(text);
    for (const auto& [key, value] : fields) {
        if (key.empty() || key[0] == '#' || key.find_first_of("=\n") != std::string::npos || !value.string() ||
            value.string()->find('\n') != std::string::npos)
            fail(STWFormat("os-release field %@ = %@", key, value));
    }
    STWValue::Dictionary again = STWParseOSRelease(render(fields));
    if (!STWValue(again).isIdenticalTo(STWValue(fields)))
        fail(STWFormat("os-release fields %@ read back as %@", STWValue(fields), STWValue(again)));
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size == 0)
        return 0;
    const std::filesystem::path& root = configurationRoot();
    bool osRelease = data[0] & 1;
    std::filesystem::path plist = root / "etc/stowly/stowlyd.plist";
    std::error_code ec;
    if (osRelease) {
        std::filesystem::remove(plist, ec);
        STWFuzzWriteInput(root / "etc/os-release", data + 1, size - 1);
        checkOSRelease(std::string_view(reinterpret_cast<const char*>(data + 1), size - 1));
    } else {
        std::filesystem::remove(root / "etc/os-release", ec);
        STWFuzzWriteInput(plist, data + 1, size - 1);
    }

    STWErrorRef error;
    auto configuration = STWPlatformConfiguration::loadFromRoot(root, &error);
    if (!configuration) {
        if (osRelease || !error || error->code() != STWErrorInvalidContent ||
            error->message().find(plist.native()) == std::string::npos)
            fail(STWFormat("refused with %@", error));
        return 0;
    }
    checkSettings(*configuration);
    if (osRelease) {
        for (const auto& [key, value] : configuration->systemVersion())
            if ((key != "BuildVersion" && key != "ProductVersion" && key != "ReleaseType") || !value.string())
                fail(STWFormat("system version %@ = %@", key, value));
    }
    return 0;
}

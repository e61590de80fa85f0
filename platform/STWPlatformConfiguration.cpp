#include "platform/STWPlatformConfiguration.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWLog.h"

#include <mutex>

namespace {

std::mutex sharedMutex;
std::shared_ptr<const STWPlatformConfiguration> shared;

} // namespace

std::shared_ptr<const STWPlatformConfiguration> STWPlatformConfiguration::sharedInstance() {
    std::lock_guard guard(sharedMutex);
    if (!shared)
        shared = std::make_shared<const STWPlatformConfiguration>("/");
    return shared;
}

void STWPlatformConfiguration::setSharedInstance(
    std::shared_ptr<const STWPlatformConfiguration> configuration) {
    std::lock_guard guard(sharedMutex);
    shared = std::move(configuration);
}

STWPlatformConfiguration::STWPlatformConfiguration(std::filesystem::path root) : _root(std::move(root)) {
    if (_root.empty())
        _root = "/";
}

std::filesystem::path STWPlatformConfiguration::resolve(const std::filesystem::path& absolute) const {
    if (_root == "/" || !absolute.is_absolute())
        return absolute;
    return _root / absolute.relative_path();
}

std::string STWPlatformConfiguration::firstBootSemaphoreName() const {
    std::string name = "/stowlyd.fb_check";
    if (!hasPrivateRoot())
        return name;
    // A short, stable hash of the root (FNV-1a) keeps the name within the kernel's limit.
    uint32_t hash = 2166136261u;
    for (unsigned char c : _root.native()) {
        hash ^= c;
        hash *= 16777619u;
    }
    return name + STWFormat(".%08x", hash);
}

bool STWPlatformConfiguration::isFeatureEnabled(std::string_view feature) const {
    const STWValue* value = STWDictionaryFind(_features, feature);
    return value && value->boolValue().value_or(false);
}

std::shared_ptr<const STWPlatformConfiguration>
STWPlatformConfiguration::loadFromRoot(const std::filesystem::path& root, STWErrorRef* error) {
    std::error_code ec;
    std::filesystem::path absoluteRoot = std::filesystem::absolute(root, ec).lexically_normal();
    if (ec || !std::filesystem::is_directory(absoluteRoot, ec)) {
        STWSetError(error, STW_POSIX_ERROR_NOLOG(ENOTDIR, "Root prefix %@ is not a directory", root));
        return nullptr;
    }
    if (absoluteRoot.native().size() > 1 && absoluteRoot.native().back() == '/')
        absoluteRoot = absoluteRoot.parent_path();
    auto configuration = std::make_shared<STWPlatformConfiguration>(absoluteRoot);
    std::filesystem::path file = configuration->configurationFile();

    if (std::filesystem::exists(std::filesystem::symlink_status(file, ec))) {
        STWErrorRef readError;
        auto settings = STW_dictionaryWithContentsOfURL(file, STWReadDefault, &readError);
        if (!settings) {
            STWSetError(error,
                        STW_ERROR_NOLOG(STWErrorInvalidContent, readError,
                                        "Malformed configuration file %@: %@", file, readError->message()));
            return nullptr;
        }
        configuration->_settings = std::move(*settings);
    }

    // Every known key must have its type; unknown keys are left to whoever owns them.
    std::string badKey;
    auto readBool = [&](const char* key, bool* out) {
        if (const STWValue* v = STWDictionaryFind(configuration->_settings, key)) {
            if (auto b = v->boolValue())
                *out = *b;
            else if (badKey.empty())
                badKey = std::string(key) + " must be a boolean";
        }
    };
    auto readUID = [&](const char* key, uid_t* out) {
        if (const STWValue* v = STWDictionaryFind(configuration->_settings, key)) {
            auto u = v->uint64Value();
            if (u && *u < static_cast<uint64_t>(static_cast<uid_t>(-1)))
                *out = static_cast<uid_t>(*u);
            else if (badKey.empty())
                badKey = std::string(key) + " must be a user id";
        }
    };
    auto readCount = [&](const char* key, auto* out) {
        if (const STWValue* v = STWDictionaryFind(configuration->_settings, key)) {
            auto u = v->uint64Value();
            if (u && *u > 0 && *u <= SIZE_MAX)
                *out = static_cast<size_t>(*u);
            else if (badKey.empty())
                badKey = std::string(key) + " must be a positive integer";
        }
    };
    auto readSeconds = [&](const char* key, std::chrono::milliseconds* out) {
        if (const STWValue* v = STWDictionaryFind(configuration->_settings, key)) {
            std::optional<double> seconds = v->realValue();
            if (seconds && *seconds >= 0.001 && *seconds <= 1e6)
                *out = std::chrono::milliseconds(static_cast<int64_t>(*seconds * 1000));
            else if (badKey.empty())
                badKey = std::string(key) + " must be a positive number of seconds";
        }
    };
    readBool("InternalImage", &configuration->_internalImage);
    readBool("MultiUser", &configuration->_multiUser);
    readBool("PersonasUnsupported", &configuration->_personasUnsupported);
    readBool("EphemeralStorage", &configuration->_ephemeralStorage);
    readBool("DeveloperMode", &configuration->_developerMode);
    readUID("InstallationUID", &configuration->_installationUID);
    readUID("SystemContainerUID", &configuration->_systemContainerUID);
    STWClientBounds& bounds = configuration->_clientBounds;
    readCount("MaxConnections", &bounds.maxConnections);
    readCount("MaxConnectionsPerUser", &bounds.maxConnectionsPerUser);
    readCount("MaxPendingFrameBytes", &bounds.maxPendingFrameBytes);
    readSeconds("FirstFrameTimeout", &bounds.firstFrameTimeout);
    readSeconds("FrameTimeout", &bounds.frameTimeout);
    if (const STWValue* v = STWDictionaryFind(configuration->_settings, "MobileUserName")) {
        if (v->string() && !v->string()->empty())
            configuration->_mobileUserName = *v->string();
        else if (badKey.empty())
            badKey = "MobileUserName must be a non-empty string";
    }
    if (const STWValue* v = STWDictionaryFind(configuration->_settings, "Features")) {
        if (const STWValue::Dictionary* features = v->dictionary()) {
            configuration->_features = *features;
            for (const auto& [name, enabled] : *features)
                if (!enabled.boolValue() && badKey.empty())
                    badKey = "Features." + name + " must be a boolean";
        } else if (badKey.empty()) {
            badKey = "Features must be a dictionary";
        }
    }
    if (!badKey.empty()) {
        STWSetError(error, STW_ERROR_NOLOG(STWErrorInvalidContent, nullptr,
                                           "Malformed configuration file %@: %@", file, badKey));
        return nullptr;
    }
    if (configuration->_developerMode && !configuration->hasPrivateRoot()) {
        STW_LOG_ERROR(STWLogCategory::Startup, "DeveloperMode is ignored for the root prefix /");
        configuration->_developerMode = false;
    }

    std::string osRelease;
    if (STWReadFileContents(configuration->resolve("/etc/os-release"), &osRelease) == 0 ||
        STWReadFileContents("/etc/os-release", &osRelease) == 0) {
        STWValue::Dictionary fields = STWParseOSRelease(osRelease);
        static const std::pair<const char*, const char*> keys[] = {
            {"BUILD_ID", "BuildVersion"}, {"VERSION_ID", "ProductVersion"}, {"RELEASE_TYPE", "ReleaseType"}};
        for (const auto& [field, key] : keys)
            if (const STWValue* v = STWDictionaryFind(fields, field))
                configuration->_systemVersion[key] = *v;
    }
    return configuration;
}

STWValue::Dictionary STWParseOSRelease(std::string_view text) {
    STWValue::Dictionary fields;
    size_t start = 0;
    while (start < text.size()) {
        size_t end = text.find('\n', start);
        if (end == std::string_view::npos)
            end = text.size();
        std::string_view line = text.substr(start, end - start);
        start = end + 1;
        size_t equals = line.find('=');
        if (line.empty() || line[0] == '#' || equals == std::string_view::npos || equals == 0)
            continue;
        std::string_view key = line.substr(0, equals);
        std::string_view raw = line.substr(equals + 1);
        std::string value;
        if (raw.size() >= 2 && (raw[0] == '"' || raw[0] == '\'') && raw.back() == raw[0]) {
            raw = raw.substr(1, raw.size() - 2);
            for (size_t i = 0; i < raw.size(); ++i) {
                if (raw[i] == '\\' && i + 1 < raw.size())
                    ++i;
                value += raw[i];
            }
        } else {
            value = raw;
        }
        fields[std::string(key)] = STWValue(std::move(value));
    }
    return fields;
}

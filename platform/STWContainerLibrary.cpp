#include "platform/STWContainerLibrary.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWLog.h"
#include "platform/STWPlatformConfiguration.h"

#include <cerrno>

namespace {

const std::vector<std::string> dataSubdirectories{"Documents", "Library", "Library/Caches", "Library/Preferences",
                                                  "SystemData", "tmp"};
const std::vector<std::string> sharedSubdirectories{"Library", "Library/Caches", "Library/Preferences"};

// A configured path must stay inside its container.
bool isSafeRelativePath(const std::string& path) {
    if (path.empty() || path.front() == '/' || containsDotDotPathComponents(path))
        return false;
    return path.find('\0') == std::string::npos;
}

} // namespace

std::optional<std::vector<std::string>>
STWContainerLibrary::subdirectoriesForContainerClass(uint64_t containerClass, STWErrorRef* error) {
    if (containerClass < 1 || containerClass > 13) {
        STWSetError(error, STW_POSIX_ERROR_NOLOG(EINVAL, "No subdirectories for container class %llu",
                                                 containerClass));
        return std::nullopt;
    }
    const auto& settings = STWPlatformConfiguration::sharedInstance()->settings();
    if (const STWValue::Dictionary* overrides = STWDictionaryDictionary(settings, "ContainerSubdirectories")) {
        if (const STWValue* list = STWDictionaryFind(*overrides, std::to_string(containerClass))) {
            std::vector<std::string> paths;
            bool valid = list->array() != nullptr;
            for (const STWValue& element : list->array() ? *list->array() : STWValue::Array{}) {
                const std::string* path = element.string();
                if (!path || !isSafeRelativePath(*path)) {
                    valid = false;
                    break;
                }
                paths.push_back(*path);
            }
            if (valid)
                return paths;
            STW_LOG_ERROR(STWLogCategory::Unspecified,
                          "Ignoring the configured subdirectories of class %llu: not an array of relative paths",
                          containerClass);
        }
    }
    switch (containerClass) {
    case 1: case 3: case 5: case 8: // bundles hold what the installer puts there
        return std::vector<std::string>{};
    case 7: case 12: case 13:
        return sharedSubdirectories;
    default:
        return dataSubdirectories;
    }
}

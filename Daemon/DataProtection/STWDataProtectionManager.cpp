#include "Daemon/DataProtection/STWDataProtectionManager.h"

#include "Daemon/CodeSigning/STWCodeSigningMapping.h"
#include "common/STWLog.h"

#include <array>
#include <utility>

const std::shared_ptr<STWDataProtectionManager>& STWDataProtectionManager::defaultManager() {
    static const std::shared_ptr<STWDataProtectionManager> manager = std::make_shared<STWDataProtectionManager>();
    return manager;
}

int32_t STWDataProtectionManager::intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
    const std::string& identifier) {
    auto mapping = STWCodeSigningMapping::sharedInstance();
    auto entitlements = mapping ? mapping->entitlementsForIdentifier(identifier) : std::nullopt;
    if (!entitlements)
        return 0;
    const std::string* name = nullptr;
    for (const char* key : {"com.vorlane.developer.default-data-protection", "data-protection-class",
                            "DataProtectionClass"})
        if ((name = STWDictionaryString(*entitlements, key)))
            break;
    if (!name)
        return 0;
    // The protection-type names an app's entitlements use on this platform.
    static constexpr std::array<std::pair<std::string_view, int32_t>, 6> types{{
        {"complete", 1},
        {"complete-unless-open", 2},
        {"complete-until-first-user-authentication", 3},
        {"none", 4},
        {"write-only", 2},
        {"complete-until-user-authentication", 3},
    }};
    for (const auto& [type, protectionClass] : types)
        if (*name == type)
            return protectionClass;
    STW_LOG_ERROR(STWLogCategory::Lifecycle, "Unknown value for DataProtectionClass entitlement: %@; defaulting to class %d",
                  *name, 0);
    return 0;
}

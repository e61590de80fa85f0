// The data-protection manager: which protection class a data container's items get. So far
// the class a new container starts with, derived from its identifier's entitlements;
// changes of a live container's class join it with their update files.
#pragma once

#include <cstdint>
#include <memory>
#include <string>

class STWDataProtectionManager {
public:
    static const std::shared_ptr<STWDataProtectionManager>& defaultManager();

    // The first string among the entitlements "com.vorlane.developer.default-data-protection",
    // "data-protection-class" and "DataProtectionClass" as a class number; 0 when there is
    // none or it names no known protection type.
    int32_t intendedDataProtectionClassBasedOnEntitlementsForIdentifier(const std::string& identifier);
};

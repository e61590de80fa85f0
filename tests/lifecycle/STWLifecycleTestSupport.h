// Lifecycle fixtures: a root with personas PERSONAL, ENT-1 (home /private/var/ent1) and a
// universal one sharing "com.shared.app"; containers with real metadata; a recording store.
#pragma once

#include "Daemon/Model/STWMetadata.h"
#include "platform/STWSandboxMappingStore.h"

#include <atomic>
#include <filesystem>
#include <map>
#include <mutex>
#include <optional>
#include <string>

struct STWTestContainer {
    std::filesystem::path url;
    STWMetadataRef metadata;
};

// Installs the root and its personas; removes what an earlier test of the process left.
void STWLifecycleTestSetUpRoot();
STWUserIdentityRef STWTestPersonalIdentity();
STWUserIdentityRef STWTestEnterpriseIdentity();

// A container (named by a new UUID unless `directoryName` is given) with valid metadata.
STWTestContainer STWMakeTestContainer(const STWUserIdentityRef& userIdentity, const std::string& identifier,
                                      STWContainerClass containerClass, bool transient = false,
                                      const std::optional<std::string>& directoryName = std::nullopt);

class STWRecordingSandboxMappingStore : public STWSandboxMappingStore {
public:
    bool setUserStateItem(const STWSandboxMappingItem& item, const std::optional<std::filesystem::path>& path,
                          STWErrorRef* error) override;
    std::optional<std::filesystem::path> userStateItem(const STWSandboxMappingItem& item) override;

    // "UID/PERSONA/ITEMTYPE/IDENTIFIER" -> path, as the file store would lay it out.
    std::map<std::string, std::filesystem::path> mappings();
    // How often a path was set for the identifier.
    int pushCount(const std::string& identifier);

    std::atomic<bool> throwOnSet{false};

private:
    std::mutex _mutex;
    std::map<std::string, std::filesystem::path> _mappings;
    std::map<std::string, int> _pushes;
};

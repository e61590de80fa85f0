// A private root prefix for tests: a temporary directory with etc/passwd (a "mobile" user
// 501 whose home is /private/var/mobile), etc/group (with "systemusers") and
// etc/stowly/, installed as the shared platform configuration. The daemon's process-wide
// objects keep the first root they see, so there is one root per test process; it is
// removed when the process exits.
#pragma once

#include "common/STWValue.h"

#include <filesystem>
#include <optional>

class STWTestRoot {
public:
    static STWTestRoot& shared();

    const std::filesystem::path& path() const { return _path; }
    std::filesystem::path resolve(const std::filesystem::path& absolute) const;
    // Rewrites etc/stowly/stowlyd.plist and reloads the shared configuration.
    void writeSettings(const STWValue::Dictionary& settings);
    // Writes etc/stowly/personas.plist (an array of persona dictionaries).
    void writePersonas(const STWValue::Array& personas);
    // One persona dictionary of such a list; a null `unique` leaves its unique string out.
    static STWValue persona(const char* unique, uint32_t id, const char* type, STWValue::Array bundles = {},
                            const char* home = nullptr) {
        STWValue::Dictionary d{{"PersonaID", STWValue(id)}, {"Type", STWValue(type)},
                               {"BundleIdentifiers", STWValue(std::move(bundles))}};
        if (unique)
            d["PersonaUniqueString"] = STWValue(unique);
        if (home)
            d["HomeLayoutPath"] = STWValue(home);
        return STWValue(std::move(d));
    }

private:
    // A new root, or the one at `existing`.
    explicit STWTestRoot(const std::optional<std::filesystem::path>& existing);
    void _reload();
    std::filesystem::path _path;
};

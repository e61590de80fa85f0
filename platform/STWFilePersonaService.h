// Personas from ROOT/etc/stowly/personas.plist: an array of dictionaries with the keys
// "PersonaUniqueString" (string), "PersonaID" (integer), "Type" ("personal",
// "enterprise", "universal" or "system"), "BundleIdentifiers" (array of strings),
// "HomeLayoutPath" (absolute path without "..", taken below the root prefix; enterprise
// personas) and "KernelType" (integer). An entry without a usable ID, type or home is
// skipped. Without the file there is one personal persona for the mobile user. The list
// is read once and kept; a change of the file (noticed with inotify) drops what was kept
// before it is reported as a persona-list update, so no request reads the file.
#pragma once

#include "common/STWValue.h"
#include "common/STWThreadSafety.h"
#include "platform/STWPersonaService.h"

#include <memory>
#include <optional>


class STWFilePersonaService : public STWPersonaService {
public:
    // Unique string of the personal persona made up when there is no personas.plist.
    static constexpr const char* defaultPersonalUniqueString = "00000000-0000-0000-0000-000000000501";

    std::vector<STWPersonaRecord> personaList() override;
    int registerForPersonaListUpdates(const std::string& observerName, std::function<void()> onUpdate,
                                      std::function<void(STWErrorRef)> completion) override;
    void unregisterForPersonaListUpdates(int token) override;

    STWFilePersonaService();

    static std::filesystem::path personaFile();
    // Parses the file's dictionary entries; invalid entries are logged and skipped.
    static std::vector<STWPersonaRecord> recordsFromPlist(const STWValue& root);
    // Reads personaFile() now, past the kept list: what personaList() keeps.
    static std::vector<STWPersonaRecord> readList();

private:
    // Shared with the watches, which may outlive a service that tests replace.
    struct Kept {
        STWMutex lock;
        std::optional<std::vector<STWPersonaRecord>> records STW_GUARDED_BY(lock);
        // Counts the changes, so that a list read while the file changed is not kept.
        uint64_t generation STW_GUARDED_BY(lock) = 0;
        bool watched STW_GUARDED_BY(lock) = false;
        void drop() {
            STWLockGuard guard(lock);
            records.reset();
            ++generation;
        }
    };
    // Drops the kept list when the file changes (also without an observer).
    void _watchOnce();
    std::shared_ptr<Kept> _kept = std::make_shared<Kept>();
};

// Personas from ROOT/etc/stowly/personas.plist: an array of dictionaries with the keys
// "PersonaUniqueString" (string), "PersonaID" (integer), "Type" ("personal",
// "enterprise", "universal" or "system"), "BundleIdentifiers" (array of strings),
// "HomeLayoutPath" (absolute path, enterprise personas) and "KernelType" (integer).
// Without the file there is one personal persona for the mobile user. Changes of the
// file are noticed with inotify and reported as persona-list updates.
#pragma once

#include "common/STWValue.h"
#include "platform/STWPersonaService.h"


class STWFilePersonaService : public STWPersonaService {
public:
    // Unique string of the personal persona made up when there is no personas.plist.
    static constexpr const char* defaultPersonalUniqueString = "00000000-0000-0000-0000-000000000501";

    std::vector<STWPersonaRecord> personaList() override;
    int registerForPersonaListUpdates(const std::string& observerName, std::function<void()> onUpdate,
                                      std::function<void(STWErrorRef)> completion) override;
    void unregisterForPersonaListUpdates(int token) override;

    static std::filesystem::path personaFile();
    // Parses the file's dictionary entries; invalid entries are logged and skipped.
    static std::vector<STWPersonaRecord> recordsFromPlist(const STWValue& root);
};

// The user-management service as the daemon sees it: the list of personas with their
// attributes, the persona of the calling context, and notifications when the list changes.
// STWFilePersonaService is the implementation; tests may install another.
#pragma once

#include "common/STWError.h"

#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

struct STWPersonaRecord {
    enum class Kind { Personal, Enterprise, Universal, System };

    std::optional<std::string> uniqueString;
    uint32_t personaID = 0;
    Kind kind = Kind::Personal;
    std::vector<std::string> bundleIdentifiers;
    // Home of an enterprise persona's containers, under the root prefix.
    std::optional<std::filesystem::path> homeLayoutPath;
    // The persona type number the kernel uses in upcalls.
    uint32_t kernelType = 0;

    bool isPersonal() const { return kind == Kind::Personal; }
    bool isEnterprise() const { return kind == Kind::Enterprise; }
    bool isUniversal() const { return kind == Kind::Universal; }
    bool isSystem() const { return kind == Kind::System; }
    std::string description() const;
};

class STWPersonaService {
public:
    virtual ~STWPersonaService() = default;

    static std::shared_ptr<STWPersonaService> sharedInstance();
    static void setSharedInstance(std::shared_ptr<STWPersonaService> service);

    // Every persona with its attributes; empty when the service cannot answer.
    virtual std::vector<STWPersonaRecord> personaList() = 0;
    // Calls `onUpdate` whenever the persona list changes; `completion` reports once
    // whether registration worked (nullptr on success). Returns the token for
    // unregisterForPersonaListUpdates(), or -1 when registration failed.
    virtual int registerForPersonaListUpdates(const std::string& observerName, std::function<void()> onUpdate,
                                              std::function<void(STWErrorRef)> completion) = 0;
    // Ends the registration; an update already being delivered may still arrive.
    virtual void unregisterForPersonaListUpdates(int token) = 0;

    // The persona the calling context acts for (see STWPersonaContext), or nullopt when
    // it acts for none.
    std::optional<STWPersonaRecord> currentPersona();
};

// Declares, for the calling thread and the lifetime of the object, the persona unique
// string the current request acts for.
class STWPersonaContext {
public:
    explicit STWPersonaContext(std::optional<std::string> personaUniqueString);
    ~STWPersonaContext();
    STWPersonaContext(const STWPersonaContext&) = delete;
    STWPersonaContext& operator=(const STWPersonaContext&) = delete;

    static const std::optional<std::string>* current();

private:
    std::optional<std::string> _personaUniqueString;
    const std::optional<std::string>* _previous;
};

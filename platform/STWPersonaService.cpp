#include "platform/STWPersonaService.h"

#include "platform/STWFilePersonaService.h"

#include <mutex>

namespace {

std::mutex sharedMutex;
std::shared_ptr<STWPersonaService> shared;
thread_local const std::optional<std::string>* currentContext = nullptr;

const char* kindName(STWPersonaRecord::Kind kind) {
    switch (kind) {
    case STWPersonaRecord::Kind::Personal:
        return "personal";
    case STWPersonaRecord::Kind::Enterprise:
        return "enterprise";
    case STWPersonaRecord::Kind::Universal:
        return "universal";
    case STWPersonaRecord::Kind::System:
        break;
    }
    return "system";
}

} // namespace

std::string STWPersonaRecord::description() const {
    std::string bundles;
    for (const std::string& b : bundleIdentifiers)
        bundles += (bundles.empty() ? "" : ", ") + b;
    return STWFormat("<persona %u %s; uniqueString = %@, bundles = (%s), home = %@>", personaID, kindName(kind),
                     uniqueString ? *uniqueString : std::string("(null)"), bundles,
                     homeLayoutPath ? homeLayoutPath->string() : std::string("(null)"));
}

std::shared_ptr<STWPersonaService> STWPersonaService::sharedInstance() {
    std::lock_guard guard(sharedMutex);
    if (!shared)
        shared = std::make_shared<STWFilePersonaService>();
    return shared;
}

void STWPersonaService::setSharedInstance(std::shared_ptr<STWPersonaService> service) {
    std::lock_guard guard(sharedMutex);
    shared = std::move(service);
}

std::optional<STWPersonaRecord> STWPersonaService::currentPersona() {
    const std::optional<std::string>* context = STWPersonaContext::current();
    if (!context || !*context)
        return std::nullopt;
    for (STWPersonaRecord& record : personaList())
        if (record.uniqueString == **context)
            return std::move(record);
    return std::nullopt;
}

STWPersonaContext::STWPersonaContext(std::optional<std::string> personaUniqueString)
    : _personaUniqueString(std::move(personaUniqueString)), _previous(currentContext) {
    currentContext = &_personaUniqueString;
}

STWPersonaContext::~STWPersonaContext() { currentContext = _previous; }

const std::optional<std::string>* STWPersonaContext::current() { return currentContext; }

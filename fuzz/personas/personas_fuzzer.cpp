// The personas file, on whatever bytes it holds: read as the persona service reads it below
// a private root, every home it keeps for a persona lies below the root prefix. A list
// with a usable personal persona then goes through the user identity cache as a
// persona-list update would, and the personal and every enterprise persona must come out
// as a user identity with an absolute home.
#include "Daemon/Model/STWUserIdentityCache.h"
#include "common/STWDictionaryUtilities.h"
#include "fuzz/STWFuzzRoot.h"
#include "platform/STWFilePersonaService.h"

#include <cstdio>
#include <cstdlib>

namespace {

// Hands the cache the list the file gave, and nothing else: the file service's own
// kept list follows the file through inotify, which would make runs depend on timing.
class ListedPersonas : public STWPersonaService {
public:
    std::vector<STWPersonaRecord> records;
    std::vector<STWPersonaRecord> personaList() override { return records; }
    int registerForPersonaListUpdates(const std::string&, std::function<void()>,
                                      std::function<void(STWErrorRef)> completion) override {
        completion(nullptr);
        return 0;
    }
    void unregisterForPersonaListUpdates(int) override {}
};

[[noreturn]] void fail(const std::string& what, const STWPersonaRecord& record) {
    fprintf(stderr, "personas fuzzer: %s: %s\n", what.c_str(), record.description().c_str());
    abort();
}

bool isBelowRoot(const std::filesystem::path& path) {
    const std::string& root = STWFuzzRoot().native();
    const std::string& text = path.native();
    return text.compare(0, root.size(), root) == 0 && text.size() > root.size() && text[root.size()] == '/' &&
           !containsDotDotPathComponents(text);
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    STWFuzzRoot();
    static const auto service = [] {
        auto listed = std::make_shared<ListedPersonas>();
        STWPersonaService::setSharedInstance(listed);
        return listed;
    }();
    static const auto cache = STWUserIdentityCache::create();

    STWFuzzWriteInput(STWFilePersonaService::personaFile(), data, size);
    std::vector<STWPersonaRecord> records = STWFilePersonaService::readList();
    const STWPersonaRecord* personal = nullptr;
    for (const STWPersonaRecord& record : records) {
        if (record.homeLayoutPath && !isBelowRoot(*record.homeLayoutPath))
            fail("kept a home outside the root", record);
        if (!personal && record.isPersonal())
            personal = &record;
    }

    // Without a personal persona that makes identities the cache waits for a better list
    // (and in the end gives up the daemon): that is its answer to a list it cannot use.
    if (!personal || !personal->uniqueString ||
        !STWUserIdentityCache::userIdentityWithPersonaAttributes(personal, false) ||
        !STWUserIdentityCache::userIdentityWithPersonaAttributes(personal, true))
        return 0;
    service->records = records;
    cache->flush();
    if (!cache->userIdentityForPersonalPersona())
        fail("no personal identity", *personal);
    for (const STWPersonaRecord& record : records) {
        if (!record.uniqueString || (!record.isEnterprise() && &record != personal))
            continue;
        STWUserIdentityRef identity = cache->userIdentityForPersonaUniqueString(record.uniqueString, 501, 501);
        if (!identity || !identity->homeDirectoryURL().is_absolute())
            fail("no user identity with an absolute home", record);
    }
    return 0;
}

// One client thread of the torture: a random mixed workload over the request socket and
// the upcall socket, against identifiers, groups and code-signing owners of its own, and
// the record (STWTortureModel) of what every reply promised. A reply that never came (the
// daemon was killed) widens the record to every outcome it allows; a reply that
// contradicts the record is a violation at once.
//
// The driver owns the workers: it runs each window's run() on a thread of its own, and
// calls the others only while no run() is under way.
#pragma once

#include "client/STWClient.h"
#include "client/STWUpcallClient.h"
#include "reliability/torture/STWTortureModel.h"

#include <atomic>
#include <chrono>
#include <map>
#include <random>
#include <string>
#include <vector>

class STWTortureWorker {
public:
    STWTortureWorker(unsigned index, uint64_t seed, std::string root);

    // The applications thread `index` installs, creates containers of and deletes.
    static constexpr unsigned applicationCount = 4;
    static std::string application(unsigned index, unsigned k);

    // Without kills (Faults, Steady) the device stays unlocked, so nothing waits for an
    // unlock, and every request must be answered within replyTimeout: a missing reply is a
    // violation. Under injected faults (Faults) any request may fail: a reply with an error
    // counts as not acknowledged (all or nothing of its change may have been made), but its
    // code must be one the daemon defines.
    enum class Mode { Kills, Faults, Steady };
    void setMode(Mode mode) { _mode = mode; }
    // Assigns the thread's applications to an enterprise persona (its unique string and
    // kernel persona id): their per-user containers live in its home, commands that name a
    // container by UUID name the persona, and the upcall asks for that persona.
    void setPersona(std::string persona, uint32_t personaID) {
        model.persona = std::move(persona);
        _personaID = personaID;
    }
    static constexpr std::chrono::seconds replyTimeout{30};

    // Sends requests until `stop` is set or the connection dies. `focus` (a crash point's
    // name, or empty) steers it towards the requests that reach that point.
    void run(STWClient& client, STWUpcallClient* upcalls, const std::atomic<bool>& stop, const std::string& focus);
    // After a restart: code-signing updates whose reply never came are sent again, so their
    // owners' entries are known once more.
    void resolve(STWClient& client);
    // Asks the daemon for every container the record holds and compares its answer with
    // what the checker found on disk (`found`: identity -> UUID and path).
    void compareWithDaemon(STWClient& client, const std::map<STWTortureIdentity, std::pair<std::string, std::string>>& found);
    // The last requests about the containers a violation names, for its report.
    std::string historyFor(const std::string& violation) const;
    // Identities of classes the sandbox maps, whose containers the daemon was asked for.
    std::vector<STWTortureIdentity> mappedIdentities() const;

    STWTortureModel model;
    std::vector<std::string> violations;
    std::map<std::string, uint64_t> acknowledged, uncertain;
    uint64_t failed = 0;                // replies with an error code under injected faults
    uint64_t requests = 0;              // sent over the request socket or the upcall socket
    std::map<std::string, std::vector<uint32_t>> latencies; // kind -> of every answered request, in microseconds

private:
    enum class Outcome { Acknowledged, Refused, Uncertain };
    Outcome _send(const char* kind, STWClient& client, STWValue::Dictionary message, STWValue::Dictionary* reply,
                  uint64_t* code);

    void _create(STWClient& client, uint64_t containerClass, const std::string& identifier, bool create);
    void _delete(STWClient& client, uint64_t containerClass, const std::string& identifier);
    void _wipe(STWClient& client, const std::string& identifier);
    void _replace(STWClient& client, uint64_t containerClass, const std::string& identifier);
    void _regenerate(STWClient& client, const STWTortureIdentity& identity);
    void _setInfo(STWClient& client, const STWTortureIdentity& identity);
    void _getInfo(STWClient& client, const STWTortureIdentity& identity);
    void _setProtection(STWClient& client, const std::string& identifier);
    void _setCodeSigning(STWClient& client, const std::string& owner, std::set<std::string> groups);
    void _groups(STWClient& client, const std::string& owner);
    void _upcall(STWUpcallClient& upcalls, const std::string& app);
    void _emptyDeathRow(STWClient& client);
    void _setKeybag(bool locked);

    // What a reply says the daemon has for `identity`; `uuid` and `existed` nullopt when it
    // does not say.
    void _observePresent(const char* how, const STWTortureIdentity& identity, const std::string& path,
                         std::optional<std::string> uuid, std::optional<bool> existed);
    void _observeAbsent(const char* how, const STWTortureIdentity& identity);
    // Makes sure the record knows the container's UUID, asking the daemon when it does not.
    bool _learn(STWClient& client, const STWTortureIdentity& identity);
    // A code-signing update of `owner` from `before` to what the owner now holds: groups no
    // entry can name any more lose their containers (for certain when `certain`).
    void _released(const std::string& owner, const std::set<std::string>& before, bool certain);
    void _violation(const std::string& text);
    void _measure(const char* kind, std::chrono::steady_clock::time_point began, bool answered);
    void _note(const STWTortureIdentity& identity, const std::string& what);

    // The enterprise persona a container of `containerClass` belongs to, which commands that
    // name it by UUID must name too; nullptr for the personal persona and for global classes.
    const std::string* _enterprisePersona(uint64_t containerClass) const;
    // A command about one container the record knows, named by its identity, UUID and persona.
    STWValue::Dictionary _containerCommand(unsigned command, const STWTortureIdentity& identity,
                                           const STWTortureExpectation& e) const;
    std::string _app(unsigned k) const;
    std::string _system(unsigned k) const;
    std::string _systemGroup(unsigned k) const;
    std::string _group(unsigned k) const;

    unsigned _index;
    std::string _root;
    std::mt19937_64 _random;
    std::map<std::string, std::set<std::string>> _pendingGroups; // owner -> groups of an unanswered update
    std::set<STWTortureIdentity> _askedFor;
    std::map<STWTortureIdentity, std::vector<std::string>> _history;
    bool _connectionDead = false;
    bool _locked = false;
    Mode _mode = Mode::Kills;
    int64_t _nextInfoValue = 1;
    uint32_t _personaID = 0xFFFFFFFFu; // none: the kernel names no persona
};

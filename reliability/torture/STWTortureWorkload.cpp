#include "reliability/torture/STWTortureWorkload.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWError.h"
#include "common/STWFileIO.h"
#include "reliability/torture/STWTortureChecker.h"

#include <cerrno>
#include <filesystem>

namespace {

constexpr std::chrono::seconds requestTimeout{3};
constexpr unsigned appCount = STWTortureWorker::applicationCount, systemCount = 2, groupCount = 3;
constexpr uint64_t notFound = 21, infoValueNotFound = 24;
const char* const applicationGroupsKey = "com.vorlane.security.application-groups";

std::string identityText(const STWTortureIdentity& identity) {
    return identity.second + " (class " + std::to_string(identity.first) + ")";
}

STWValue::Dictionary identityKeys(uint64_t containerClass, const std::string& identifier) {
    return {{"Identifier", STWValue(identifier)}, {"ContainerClass", STWValue(containerClass)}};
}

} // namespace

const std::string* STWTortureWorker::_enterprisePersona(uint64_t containerClass) const {
    return !model.persona.empty() && STWTortureChecker::isPerUser(containerClass) ? &model.persona : nullptr;
}

STWValue::Dictionary STWTortureWorker::_containerCommand(unsigned command, const STWTortureIdentity& identity,
                                                         const STWTortureExpectation& e) const {
    STWValue::Dictionary message = identityKeys(identity.first, identity.second);
    message["Command"] = STWValue(command);
    message["UUID"] = STWValue(*STWUUID::fromString(e.uuid()));
    if (const std::string* persona = _enterprisePersona(identity.first))
        message["PersonaUniqueString"] = STWValue(*persona);
    return message;
}

STWTortureWorker::STWTortureWorker(unsigned index, uint64_t seed, std::string root)
    : _index(index), _root(std::move(root)), _random(seed * 7919 + index) {
    for (unsigned k = 0; k < appCount; ++k)
        model.owners[_app(k)];
}

std::string STWTortureWorker::application(unsigned index, unsigned k) {
    return "com.torture.t" + std::to_string(index) + ".app" + std::to_string(k);
}
std::string STWTortureWorker::_app(unsigned k) const { return application(_index, k); }
std::string STWTortureWorker::_system(unsigned k) const {
    return "com.torture.t" + std::to_string(_index) + ".system" + std::to_string(k);
}
std::string STWTortureWorker::_systemGroup(unsigned k) const {
    return "systemgroup.torture.t" + std::to_string(_index) + ".sg" + std::to_string(k);
}
std::string STWTortureWorker::_group(unsigned k) const {
    return "group.torture.t" + std::to_string(_index) + ".g" + std::to_string(k);
}

void STWTortureWorker::_violation(const std::string& text) { violations.push_back(text); }

void STWTortureWorker::_measure(const char* kind, std::chrono::steady_clock::time_point began, bool answered) {
    ++requests;
    if (answered && _mode == Mode::Steady)
        latencies[kind].push_back(uint32_t(std::chrono::duration_cast<std::chrono::microseconds>(
                                         std::chrono::steady_clock::now() - began).count()));
}

void STWTortureWorker::_note(const STWTortureIdentity& identity, const std::string& what) {
    auto& lines = _history[identity];
    if (lines.size() >= 8)
        lines.erase(lines.begin());
    lines.push_back(what);
}

std::string STWTortureWorker::historyFor(const std::string& violation) const {
    std::string text;
    for (const auto& [identity, lines] : _history) {
        if (violation.find(identityText(identity)) == std::string::npos &&
            violation.find(" of " + identity.second + ",") == std::string::npos)
            continue;
        text += "\n    last requests about " + identityText(identity) + ":";
        for (const auto& line : lines)
            text += "\n      " + line;
    }
    return text;
}

STWTortureWorker::Outcome STWTortureWorker::_send(const char* kind, STWClient& client, STWValue::Dictionary message,
                                                  STWValue::Dictionary* reply, uint64_t* code) {
    STWErrorRef error;
    auto began = std::chrono::steady_clock::now();
    auto answer = client.sendMessage(message, _mode != Mode::Kills ? replyTimeout : requestTimeout, &error);
    _measure(kind, began, answer.has_value());
    const std::string* identifier = STWDictionaryString(message, "Identifier");
    if (!identifier)
        identifier = STWDictionaryString(message, "NewIdentifier");
    auto containerClass = STWDictionaryUInt64(message, STWDictionaryFind(message, "ContainerClass")
                                                           ? "ContainerClass" : "NewContainerClass");
    if (identifier && containerClass)
        _note({*containerClass, *identifier},
              std::string(kind) + ": " +
                  (answer ? "code " + std::to_string(STWDictionaryUInt64(*answer, "ReplyError").value_or(0))
                          : std::string("no reply")));
    if (!answer && _mode != Mode::Kills) {
        // Nothing waits for an unlock here, and faults must never stop or kill the daemon.
        _violation(std::string(kind) + (error && error->isPOSIX(ETIMEDOUT)
                                            ? " got no reply within " + std::to_string(replyTimeout.count()) + " s"
                                            : " got no reply: the connection ended"));
        _connectionDead = true;
        ++uncertain[kind];
        return Outcome::Uncertain;
    }
    if (!answer) {
        // A time-out leaves the connection usable (a change waiting for an unlock, say);
        // anything else means the daemon is gone.
        if (!error || !error->isPOSIX(ETIMEDOUT))
            _connectionDead = true;
        ++uncertain[kind];
        return Outcome::Uncertain;
    }
    *reply = std::move(*answer);
    *code = STWDictionaryUInt64(*reply, "ReplyError").value_or(0);
    // Not found is an answer about the disk, which a fault must not falsify.
    if (*code != STWErrorSuccess && _mode == Mode::Faults && *code != notFound && *code != infoValueNotFound) {
        if (!STWErrorCodeName(*code))
            _violation(std::string(kind) + " answered with code " + std::to_string(*code) +
                       ", which the daemon does not define");
        ++failed;
        return Outcome::Uncertain;
    }
    if (*code != STWErrorSuccess)
        return Outcome::Refused;
    ++acknowledged[kind];
    return Outcome::Acknowledged;
}

void STWTortureWorker::_observePresent(const char* how, const STWTortureIdentity& identity, const std::string& path,
                                       std::optional<std::string> uuid, std::optional<bool> existed) {
    STWTortureExpectation& e = model.containers.emplace(identity, STWTortureExpectation::absent()).first->second;
    std::string problem;
    bool mustHaveExisted = !existed || *existed;
    // After a deletion that answered success (under faults) it is the old container, left in
    // place, or a new one.
    bool knownBefore = e.mayBePresent && mustHaveExisted && !e.deletionAnswered;
    if (!e.mayBePresent && mustHaveExisted && existed)
        problem = "answered as existing";
    else if (!e.mayBeAbsent && existed && !*existed)
        problem = "made anew";
    else if (knownBefore && uuid && !e.uuids.empty() && !e.uuids.count(*uuid))
        problem = "answered with UUID " + *uuid;
    else if (knownBefore && !e.mayBeAbsent && !e.path.empty() && e.path != path)
        problem = "answered at " + path;
    else if (e.excluded.count(path))
        problem = "answered at its old path " + path;
    if (!problem.empty())
        _violation(std::string(how) + " of " + identityText(identity) + " " + problem + "; expected " +
                   e.description());
    _note(identity, std::string(how) + ": " + (uuid ? *uuid : std::string("?")) + " at " + path);
    bool same = e.definitelyPresent() && (uuid ? e.uuid() == *uuid : e.path == path);
    STWTortureExpectation next = STWTortureExpectation::present(uuid ? *uuid : same ? e.uuid() : "", path);
    if (!uuid && !same)
        next.uuids.clear(); // made by this request, or moved: the checker learns its UUID
    if (same) {
        next.info = e.info;
        next.protection = e.protection;
        next.protectionMayBePartial = e.protectionMayBePartial;
    } else if (!existed || *existed) {
        next.info.clear(); // an older container at a path not known yet: its values are learnt
    }
    e = std::move(next);
}

void STWTortureWorker::_observeAbsent(const char* how, const STWTortureIdentity& identity) {
    STWTortureExpectation& e = model.containers.emplace(identity, STWTortureExpectation::absent()).first->second;
    _note(identity, std::string(how) + ": none");
    if (!e.mayBeAbsent)
        _violation(std::string(how) + " of " + identityText(identity) + " found nothing; expected " + e.description());
    e = STWTortureExpectation::absent();
}

void STWTortureWorker::_create(STWClient& client, uint64_t containerClass, const std::string& identifier,
                               bool create) {
    STWValue::Dictionary message = identityKeys(containerClass, identifier);
    message["Command"] = STWValue(0u);
    message["CreateIfNecessary"] = STWValue(create);
    message["Transient"] = STWValue(false);
    STWValue::Dictionary reply;
    uint64_t code = 0;
    STWTortureIdentity identity{containerClass, identifier};
    _askedFor.insert(identity);
    const char* kind = create ? "create" : "lookup";
    switch (_send(kind, client, message, &reply, &code)) {
    case Outcome::Acknowledged: {
        const std::string* path = STWDictionaryString(reply, "ReplyPath");
        const STWValue* uuid = STWDictionaryFind(reply, "ReplyUUID");
        if (!path || !uuid || !uuid->uuid()) {
            _violation(std::string(kind) + " of " + identityText(identity) + " answered without path or UUID");
            break;
        }
        const std::string* persona = STWDictionaryString(reply, "ReplyPersonaUniqueString");
        const std::string* expected = _enterprisePersona(containerClass);
        if (expected && (!persona || *persona != *expected))
            _violation(std::string(kind) + " of " + identityText(identity) + " answered persona " +
                       (persona ? *persona : std::string("none")) + ", not " + *expected);
        _observePresent(kind, identity, *path, uuid->uuid()->string(),
                        create ? STWDictionaryBool(reply, "ReplyExisted") : std::optional<bool>(true));
        break;
    }
    case Outcome::Refused:
        if (!create && code == notFound)
            _observeAbsent(kind, identity);
        else
            _violation(std::string(kind) + " of " + identityText(identity) + " refused with " + std::to_string(code));
        break;
    case Outcome::Uncertain:
        if (create) {
            auto& e = model.containers.emplace(identity, STWTortureExpectation::absent()).first->second;
            e.mayBePresent = true;
        }
        break;
    }
}

bool STWTortureWorker::_learn(STWClient& client, const STWTortureIdentity& identity) {
    auto it = model.containers.find(identity);
    if (it != model.containers.end() && it->second.definitelyPresent())
        return true;
    if (it != model.containers.end() && it->second.definitelyAbsent())
        return false;
    _create(client, identity.first, identity.second, false);
    it = model.containers.find(identity);
    return it != model.containers.end() && it->second.definitelyPresent();
}

void STWTortureWorker::_delete(STWClient& client, uint64_t containerClass, const std::string& identifier) {
    STWValue::Dictionary message = identityKeys(containerClass, identifier);
    message["Command"] = STWValue(10u);
    message["Transient"] = STWValue(false);
    STWValue::Dictionary reply;
    uint64_t code = 0;
    STWTortureIdentity identity{containerClass, identifier};
    auto& e = model.containers.emplace(identity, STWTortureExpectation::absent()).first->second;
    Outcome outcome = _send("delete", client, message, &reply, &code);
    if (outcome == Outcome::Acknowledged && _mode == Mode::Faults) {
        // A container that could be neither moved to death row nor removed stays where it
        // was, and the deletion still answers success; the checker asks the daemon's log.
        e.mayBeAbsent = true;
        e.deletionAnswered = e.mayBePresent;
    } else if (outcome == Outcome::Acknowledged)
        e = STWTortureExpectation::absent();
    else if (outcome == Outcome::Refused && code == notFound)
        _observeAbsent("delete", identity);
    else
        e.mayBeAbsent = true;
    // An application's bundle going means the application is gone: its code-signing entry
    // goes with it, and so do the groups only it named.
    if (containerClass == 1 && model.owners.count(identifier) && !(outcome == Outcome::Refused && code == notFound)) {
        auto& entry = model.owners[identifier];
        std::set<std::string> before = entry.groups;
        before.insert(entry.possible.begin(), entry.possible.end());
        if (outcome == Outcome::Acknowledged) {
            entry = {};
            _pendingGroups.erase(identifier);
        } else {
            // Either way, the entry is set again once the daemon is back.
            entry.possible = before;
            entry.uncertain = true;
            _pendingGroups.emplace(identifier, entry.groups);
        }
        for (const auto& group : before)
            _note({7, group}, "delete of the bundle of " + identifier + ": " +
                                  (outcome == Outcome::Acknowledged ? "acknowledged" : "no reply"));
        _released(identifier, before, outcome == Outcome::Acknowledged);
    }
}

void STWTortureWorker::_wipe(STWClient& client, const std::string& identifier) {
    STWTortureIdentity identity{2, identifier};
    if (!_learn(client, identity))
        return;
    STWValue::Dictionary message = identityKeys(2, identifier);
    message["Command"] = STWValue(12u);
    STWValue::Dictionary reply;
    uint64_t code = 0;
    Outcome outcome = _send("wipe", client, message, &reply, &code);
    // Acknowledged or not, a wipe keeps the container's path and UUID; only its content
    // (and whatever its info dictionary held) may have gone.
    auto& e = model.containers.at(identity);
    e.info.clear();
    e.protection.clear();
    // A replace that fails once the old container is parked sends it to death row with its
    // staging: a wipe answered with an error (under faults) may leave no container at all.
    if (outcome == Outcome::Uncertain && code > STWErrorSuccess)
        e.mayBeAbsent = true;
    if (outcome == Outcome::Refused)
        _violation("wipe of " + identityText(identity) + " refused with " + std::to_string(code));
}

void STWTortureWorker::_replace(STWClient& client, uint64_t containerClass, const std::string& identifier) {
    STWTortureIdentity identity{containerClass, identifier};
    if (!_learn(client, identity))
        return;
    std::string oldUUID = model.containers.at(identity).uuid();
    STWValue::Dictionary message = identityKeys(containerClass, identifier);
    message["Command"] = STWValue(0u);
    message["CreateIfNecessary"] = STWValue(true);
    message["Transient"] = STWValue(true);
    STWValue::Dictionary fresh;
    uint64_t code = 0;
    if (_send("transient", client, message, &fresh, &code) != Outcome::Acknowledged)
        return; // a transient container left behind goes with the next power cycle
    const STWValue* newUUID = STWDictionaryFind(fresh, "ReplyUUID");
    const std::string* freshPath = STWDictionaryString(fresh, "ReplyPath");
    if (!newUUID || !newUUID->uuid() || !freshPath)
        return _violation("transient container of " + identityText(identity) + " answered without UUID or path");
    STWValue::Dictionary replace{{"Command", STWValue(2u)},
                                 {"OldIdentifier", STWValue(identifier)},
                                 {"OldContainerClass", STWValue(containerClass)},
                                 {"OldContainerUUID", STWValue(*STWUUID::fromString(oldUUID))},
                                 {"NewIdentifier", STWValue(identifier)},
                                 {"NewContainerClass", STWValue(containerClass)},
                                 {"NewContainerUUID", *newUUID}};
    if (const std::string* persona = _enterprisePersona(containerClass)) {
        replace["OldPersonaUniqueString"] = STWValue(*persona);
        replace["NewPersonaUniqueString"] = STWValue(*persona);
    }
    STWValue::Dictionary reply;
    auto& e = model.containers.at(identity);
    switch (_send("replace", client, replace, &reply, &code)) {
    case Outcome::Acknowledged:
        e = STWTortureExpectation::present(newUUID->uuid()->string(), "");
        e.info.clear();
        break;
    case Outcome::Refused:
        _violation("replace of " + identityText(identity) + " refused with " + std::to_string(code));
        [[fallthrough]];
    case Outcome::Uncertain:
        // The old container or the new one, never both; neither only after an error reply
        // (the failed replace discarded the parked old one), never after a kill.
        if (code > STWErrorSuccess)
            e.mayBeAbsent = true;
        e.uuids.insert(newUUID->uuid()->string());
        e.path.clear();
        e.info.clear();
        e.protection.clear();
        break;
    }
}

void STWTortureWorker::_regenerate(STWClient& client, const STWTortureIdentity& identity) {
    if (!_learn(client, identity))
        return;
    auto& e = model.containers.at(identity);
    STWValue::Dictionary message = _containerCommand(9, identity, e);
    STWValue::Dictionary reply;
    uint64_t code = 0;
    Outcome outcome = _send("regenerate-uuid", client, message, &reply, &code);
    if (outcome == Outcome::Refused)
        _violation("regeneration of " + identityText(identity) + " refused with " + std::to_string(code));
    // The container keeps its UUID and moves to a directory of a new name.
    if (outcome == Outcome::Acknowledged)
        e.excluded.insert(e.path);
    e.path.clear();
    e.info.clear();
    e.protection.clear();
}

void STWTortureWorker::_setInfo(STWClient& client, const STWTortureIdentity& identity) {
    if (!_learn(client, identity))
        return;
    auto& e = model.containers.at(identity);
    int64_t value = _nextInfoValue++;
    STWValue::Dictionary message = _containerCommand(5, identity, e);
    message["Key"] = STWValue(STWTortureChecker::infoKey);
    message["Value"] = STWValue(value);
    STWValue::Dictionary reply;
    uint64_t code = 0;
    switch (_send("info-set", client, message, &reply, &code)) {
    case Outcome::Acknowledged:
        e.info = {value};
        break;
    case Outcome::Refused:
        _violation("info-set of " + identityText(identity) + " refused with " + std::to_string(code));
        [[fallthrough]];
    case Outcome::Uncertain:
        if (!e.info.empty())
            e.info.insert(value);
        break;
    }
}

void STWTortureWorker::_getInfo(STWClient& client, const STWTortureIdentity& identity) {
    if (!_learn(client, identity))
        return;
    auto& e = model.containers.at(identity);
    STWValue::Dictionary message = _containerCommand(6, identity, e);
    message["Key"] = STWValue(STWTortureChecker::infoKey);
    STWValue::Dictionary reply;
    uint64_t code = 0;
    Outcome outcome = _send("info-get", client, message, &reply, &code);
    if (outcome == Outcome::Uncertain || (outcome == Outcome::Refused && code != infoValueNotFound))
        return;
    const STWValue* value = STWDictionaryFind(reply, "ReplyInfoValue");
    int64_t found = outcome == Outcome::Refused ? -1 : value ? value->truncatedInt64Value().value_or(-2) : -2;
    if (!e.info.empty() && !e.info.count(found))
        _violation("info-get of " + identityText(identity) + " answered " + std::to_string(found) + "; expected " +
                   e.description());
    e.info = {found};
}

void STWTortureWorker::_setProtection(STWClient& client, const std::string& identifier) {
    STWTortureIdentity identity{2, identifier};
    if (!_learn(client, identity))
        return;
    static const int64_t classes[] = {1, 3, 4};
    int64_t protectionClass = classes[_random() % 3];
    STWValue::Dictionary message = identityKeys(2, identifier);
    message["Command"] = STWValue(21u);
    message["DataProtectionClass"] = STWValue(protectionClass);
    message["IsThirdParty"] = STWValue(false);
    message["RetryIfLocked"] = STWValue(bool(_random() % 2));
    STWValue::Dictionary reply;
    uint64_t code = 0;
    auto& e = model.containers.at(identity);
    // Refused (locked, superseded): the walk may have begun, and the record is either.
    // Under faults the class may fail to be recorded although the change succeeded.
    Outcome outcome = _send("set-protection", client, message, &reply, &code);
    if (outcome == Outcome::Acknowledged && _mode != Mode::Faults) {
        e.protection = {protectionClass};
        e.protectionMayBePartial = false;
    } else {
        if (!e.protection.empty())
            e.protection.insert(protectionClass);
        e.protectionMayBePartial = true;
    }
}

void STWTortureWorker::_released(const std::string& owner, const std::set<std::string>& before, bool certain) {
    const auto& entry = model.owners[owner];
    for (const auto& group : before) {
        if (entry.groups.count(group) && !entry.uncertain)
            continue;
        bool named = false;
        for (const auto& [name, other] : model.owners)
            named = named || (name != owner && (other.groups.count(group) || other.possible.count(group)));
        if (named)
            continue;
        auto& e = model.containers.emplace(STWTortureIdentity{7, group}, STWTortureExpectation::absent())
                      .first->second;
        if (certain)
            e = STWTortureExpectation::absent();
        else
            e.mayBeAbsent = true;
    }
}

void STWTortureWorker::_setCodeSigning(STWClient& client, const std::string& owner, std::set<std::string> groups) {
    STWValue::Array array;
    for (const auto& group : groups)
        array.emplace_back(group);
    STWValue::Dictionary entitlements{{applicationGroupsKey, STWValue(std::move(array))}};
    STWValue::Dictionary message{
        {"Command", STWValue(18u)},
        {"Identifier", STWValue(owner)},
        {"CodeSigningInfo",
         STWValue(STWValue::Dictionary{{"com.vorlane.Stowly.Entitlements", STWValue(std::move(entitlements))}})},
        {"OptionsDictionary", STWValue(STWValue::Dictionary{})}};
    STWValue::Dictionary reply;
    uint64_t code = 0;
    auto& entry = model.owners[owner];
    std::set<std::string> before = entry.groups;
    before.insert(entry.possible.begin(), entry.possible.end());
    Outcome outcome = _send("set-codesigning", client, message, &reply, &code);
    std::string names;
    for (const auto& group : groups)
        names += " " + group;
    for (unsigned k = 0; k < groupCount; ++k)
        _note({7, _group(k)}, "set-codesigning of " + owner + " to {" + names + " }: " +
                                  (outcome == Outcome::Acknowledged ? "acknowledged" : "no reply"));
    if (outcome == Outcome::Acknowledged) {
        entry.groups = std::move(groups);
        entry.possible.clear();
        entry.uncertain = false;
        _pendingGroups.erase(owner);
        _released(owner, before, true);
    } else {
        entry.possible = before;
        entry.possible.insert(groups.begin(), groups.end());
        entry.uncertain = true;
        _pendingGroups[owner] = std::move(groups);
        _released(owner, before, false);
    }
}

void STWTortureWorker::_groups(STWClient& client, const std::string& owner) {
    STWValue::Dictionary reply;
    uint64_t code = 0;
    const auto& entry = model.owners[owner];
    if (_send("groups", client, {{"Command", STWValue(13u)}, {"Identifier", STWValue(owner)}}, &reply, &code) !=
        Outcome::Acknowledged) {
        // Any group the entry names may have been made.
        std::set<std::string> named = entry.groups;
        named.insert(entry.possible.begin(), entry.possible.end());
        for (const auto& group : named) {
            _note({7, group}, "groups of " + owner + ": no answer");
            model.containers.emplace(STWTortureIdentity{7, group}, STWTortureExpectation::absent())
                .first->second.mayBePresent = true;
        }
        return;
    }
    const STWValue::Dictionary* paths = STWDictionaryDictionary(reply, "ReplyGroupContainerDict");
    std::set<std::string> answered;
    for (const auto& [group, path] : paths ? *paths : STWValue::Dictionary{}) {
        answered.insert(group);
        if (!entry.groups.count(group) && !entry.possible.count(group))
            _violation("groups of " + owner + " answered " + group + ", which its entry does not name");
        if (path.string())
            _observePresent("groups", {7, group}, *path.string(), std::nullopt, std::nullopt);
        _askedFor.insert({7, group});
    }
    // A group whose container cannot be made is left out, and the others still answered: under
    // faults that group's container may or may not be there.
    if (!entry.uncertain) {
        for (const auto& group : entry.groups) {
            if (!answered.count(group) && _mode == Mode::Faults)
                model.containers.emplace(STWTortureIdentity{7, group}, STWTortureExpectation::absent())
                    .first->second.mayBePresent = true;
            else if (!answered.count(group))
                _violation("groups of " + owner + " left out " + group);
        }
    }
}

void STWTortureWorker::_upcall(STWUpcallClient& upcalls, const std::string& app) {
    const auto& entry = model.owners[app];
    STWUpcallClient::Request request;
    request.codeSignatureIdentifier = app;
    request.uid = 501;
    request.containerType = 0;
    request.personaID = _personaID;
    if (!entry.uncertain)
        request.appGroupIdentifiers.assign(entry.groups.begin(), entry.groups.end());
    std::string system = _system(_random() % systemCount);
    request.systemContainerIdentifier = system;
    STWErrorRef error;
    auto began = std::chrono::steady_clock::now();
    auto reply = upcalls.send(request, _mode != Mode::Kills ? replyTimeout : requestTimeout, &error);
    _measure("upcall", began, reply.has_value());
    if (!reply && _mode != Mode::Kills)
        _violation("upcall for " + app + " got no reply");
    std::vector<STWTortureIdentity> named{{2, app}, {12, system}};
    for (const auto& group : request.appGroupIdentifiers)
        named.push_back({7, group});
    for (const auto& identity : named)
        _askedFor.insert(identity);
    if (!reply || reply->returnCode != 0 || reply->status != 1) {
        if (!reply)
            _connectionDead = _connectionDead || !error || !error->isPOSIX(ETIMEDOUT);
        ++uncertain["upcall"];
        // Each container named may have been made; none was removed.
        for (const auto& identity : named) {
            _note(identity, "upcall: no answer");
            model.containers.emplace(identity, STWTortureExpectation::absent()).first->second.mayBePresent = true;
        }
        return;
    }
    ++acknowledged["upcall"];
    if (reply->dataContainer)
        _observePresent("upcall", {2, app}, *reply->dataContainer, std::nullopt, std::nullopt);
    if (reply->systemContainer)
        _observePresent("upcall", {12, system}, *reply->systemContainer, std::nullopt, std::nullopt);
    for (const auto& [group, path] : reply->appGroups)
        _observePresent("upcall", {7, group}, path, std::nullopt, std::nullopt);
}

void STWTortureWorker::_emptyDeathRow(STWClient& client) {
    STWValue::Dictionary reply;
    uint64_t code = 0;
    _send("empty-deathrow", client, {{"Command", STWValue(4u)}}, &reply, &code);
}

void STWTortureWorker::_setKeybag(bool locked) {
    std::filesystem::path directory = std::filesystem::path(_root) / "run/stowly";
    if (STWWriteFileAtomically(directory / "keybag", locked ? "locked" : "unlocked", 0644, false) == 0)
        _locked = locked;
}

void STWTortureWorker::run(STWClient& client, STWUpcallClient* upcalls, const std::atomic<bool>& stop,
                           const std::string& focus) {
    _connectionDead = false;
    auto pick = [this](unsigned n) { return unsigned(_random() % n); };
    bool protection = focus.starts_with("protection."), removal = focus.starts_with("delete.") ||
                                                                  focus.starts_with("deathrow."),
         replacing = focus.starts_with("replace."), creating = focus.starts_with("create."),
         codeSigning = focus.starts_with("codesigning.");
    while (!stop.load() && !_connectionDead) {
        std::string app = _app(pick(appCount));
        uint64_t classes[] = {1, 2, 2, 12, 13};
        uint64_t containerClass = classes[pick(5)];
        std::string identifier = containerClass == 12   ? _system(pick(systemCount))
                                 : containerClass == 13 ? _systemGroup(pick(systemCount))
                                                        : app;
        unsigned roll = pick(100);
        // A crash point is reached sooner when its requests come more often.
        if ((protection && roll < 40) || (removal && roll < 20) || (replacing && roll < 25) ||
            (creating && roll < 30) || (codeSigning && roll < 30)) {
            if (codeSigning)
                roll < 15 ? _groups(client, app) : _setCodeSigning(client, app, {_group(pick(groupCount))});
            else if (protection)
                _setProtection(client, app);
            else if (removal && roll < 10)
                _delete(client, containerClass, identifier);
            else if (removal)
                _emptyDeathRow(client);
            else if (replacing)
                roll < 12 ? _wipe(client, app) : _replace(client, pick(2) ? 1 : 2, app);
            else
                _create(client, containerClass, identifier, true);
            continue;
        }
        roll = pick(100);
        if (roll < 20)
            _create(client, containerClass, identifier, true);
        else if (roll < 28)
            _create(client, containerClass, identifier, false);
        else if (roll < 36)
            _delete(client, containerClass, identifier);
        else if (roll < 41)
            _wipe(client, app);
        else if (roll < 48)
            _replace(client, pick(2) ? 1 : 2, app);
        else if (roll < 55)
            _setInfo(client, {containerClass, identifier});
        else if (roll < 60)
            _getInfo(client, {containerClass, identifier});
        else if (roll < 64)
            _regenerate(client, {containerClass, identifier});
        else if (roll < 71)
            _setProtection(client, app);
        else if (roll < 78) {
            std::set<std::string> groups;
            for (unsigned k = 0; k < groupCount; ++k)
                if (pick(2))
                    groups.insert(_group(k));
            _setCodeSigning(client, app, std::move(groups));
        } else if (roll < 85)
            _groups(client, app);
        else if (roll < 92 && upcalls)
            _upcall(*upcalls, app);
        else if (roll < 95)
            _emptyDeathRow(client);
        else if (_index == 0 && _mode == Mode::Kills)
            _setKeybag(!_locked);
    }
}

void STWTortureWorker::resolve(STWClient& client) {
    if (_locked)
        _setKeybag(false);
    auto pending = _pendingGroups;
    for (auto& [owner, groups] : pending)
        _setCodeSigning(client, owner, groups);
}

void STWTortureWorker::compareWithDaemon(
    STWClient& client, const std::map<STWTortureIdentity, std::pair<std::string, std::string>>& found) {
    for (const auto& [identity, expected] : model.containers) {
        STWValue::Dictionary message = identityKeys(identity.first, identity.second);
        message["Command"] = STWValue(0u);
        message["CreateIfNecessary"] = STWValue(false);
        message["Transient"] = STWValue(false);
        STWErrorRef error;
        auto reply = client.sendMessage(message, requestTimeout, &error);
        if (!reply) {
            _violation("lookup of " + identityText(identity) + " got no reply from a running daemon");
            continue;
        }
        uint64_t code = STWDictionaryUInt64(*reply, "ReplyError").value_or(0);
        auto it = found.find(identity);
        const std::string* path = STWDictionaryString(*reply, "ReplyPath");
        const STWValue* uuid = STWDictionaryFind(*reply, "ReplyUUID");
        std::string answered = code == STWErrorSuccess
                                   ? (uuid && uuid->uuid() ? uuid->uuid()->string() : "?") + " at " +
                                         (path ? *path : "?")
                                   : "code " + std::to_string(code);
        std::string onDisk = it == found.end() ? "nothing" : it->second.first + " at " + it->second.second;
        if (it == found.end() ? code != notFound : answered != onDisk)
            _violation("the daemon answers " + identityText(identity) + " with " + answered + ", the disk holds " +
                       onDisk);
        if (code == STWErrorSuccess)
            _askedFor.insert(identity);
    }
}

std::vector<STWTortureIdentity> STWTortureWorker::mappedIdentities() const {
    return {_askedFor.begin(), _askedFor.end()};
}

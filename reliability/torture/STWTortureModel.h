// What the torture's clients were told, kept per container identity: the state an
// acknowledged reply promised, widened to every outcome a reply that never came allows.
// Plain standard types only, so the checker that reads it needs none of the daemon's code.
//
// Each client thread owns its identifiers, groups and owners outright (the names carry
// the thread's number), so one thread's replies arrive in the order their changes took
// effect; the checker reads every thread's model while all of them are stopped.
#pragma once

#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <utility>

// A container identity as the disk shows it: class and identifier. Every per-user container
// here belongs to the mobile user, in the persona of the thread that owns its identifier
// (STWTortureModel::persona); global ones belong to nobody.
using STWTortureIdentity = std::pair<uint64_t, std::string>;

struct STWTortureExpectation {
    bool mayBeAbsent = true;
    bool mayBePresent = false;
    std::set<std::string> uuids;    // when present, its UUID is one of these; empty: any
    std::set<std::string> excluded; // paths it may no longer have (it was moved away from them)
    std::string path;               // when present with a known path, that path (its directory
                                    // has a UUID name of its own, which only a regeneration changes)
    std::set<int64_t> info;         // torture info value on disk (-1: none); empty: not checked
    std::set<int64_t> protection;   // recorded protection class (-1: none); empty: not checked
    bool protectionMayBePartial = false; // a change refused once its walk began (the device
                                         // locked meanwhile) may have left the data at either
                                         // class, until a change goes through
    bool deletionAnswered = false; // under faults: its deletion answered success, yet it may
                                   // stay if the daemon could neither move nor remove it

    static STWTortureExpectation absent() { return {}; }
    static STWTortureExpectation present(std::string uuid, std::string path) {
        STWTortureExpectation e;
        e.mayBeAbsent = false;
        e.mayBePresent = true;
        e.uuids = {std::move(uuid)};
        e.path = std::move(path);
        e.info = {-1};
        return e;
    }
    // Nothing is known: the outcome of a reply that never came, with nothing to narrow it.
    static STWTortureExpectation unknown() {
        STWTortureExpectation e;
        e.mayBePresent = true;
        return e;
    }
    bool definitelyPresent() const { return mayBePresent && !mayBeAbsent && uuids.size() == 1; }
    bool definitelyAbsent() const { return mayBeAbsent && !mayBePresent; }
    std::string uuid() const { return uuids.size() == 1 ? *uuids.begin() : std::string(); }
    std::string description() const;
};

// One thread's share of the workload: its containers and the application groups each of
// its owners' stored code-signing entries names.
struct STWTortureModel {
    std::map<STWTortureIdentity, STWTortureExpectation> containers;
    // The enterprise persona (its unique string) the thread's applications are assigned to,
    // whose home holds their per-user containers; empty: the personal persona's.
    std::string persona;
    struct Owner {
        std::set<std::string> groups;   // as the last acknowledged update stored them
        std::set<std::string> possible; // with an unacknowledged update: old and new together
        bool uncertain = false;
    };
    std::map<std::string, Owner> owners;

    // Whether some owner's entry names (or, after an update without a reply, may name) `group`.
    bool mayReference(const std::string& group) const {
        for (const auto& [name, owner] : owners)
            if (owner.groups.count(group) || owner.possible.count(group))
                return true;
        return false;
    }
};

// The torture's invariant checker: reads a stopped-or-idle daemon's root straight from
// disk, with POSIX calls and libplist, and compares it with what the clients were told.
// It shares no code with the daemon (no metadata, cache or layout classes), so a fault in
// those cannot hide itself from the check: the layout below is written down here again.
//
// Used by stowly_torture after every restart once the start's cleanups have finished, and
// by its tests on roots they lay out by hand. Not thread-safe; nothing else may change the
// models while it runs.
#pragma once

#include "reliability/torture/STWTortureModel.h"

#include <chrono>
#include <filesystem>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

class STWTortureChecker {
public:
    // Under injected faults a protection change may change the data and then fail to record
    // its class (the failure is logged, the reply still succeeds): the recorded class may
    // then lag behind the data's.
    bool recordedProtectionMayLag = false;
    // Under injected faults a container may be neither moved to death row nor removed in
    // place; the deletion logs that and still answers success. The paths the daemon's log
    // names so: only these may stay after a deletion that answered success.
    std::set<std::string> undeletable;
    // The homes of enterprise personas (relative to the root) and the unique string of each:
    // their per-user class directories are scanned beside the mobile user's.
    std::map<std::string, std::string> enterpriseHomes;

    // A container as its class directory and metadata file show it.
    struct Container {
        uint64_t containerClass = 0;
        std::string identifier;
        std::string uuid;
        std::string path;
        int64_t info = -1;       // the torture's info value, -1 when none
        int64_t protection = -1; // the recorded protection class, -1 when none
        int64_t documentsClass = -1; // the protection class of its Documents, -1 when none
        std::string persona;         // the persona unique string its metadata records, if any
    };

    explicit STWTortureChecker(std::filesystem::path root) : _root(std::move(root)) {}

    // Scans every class directory and checks the disk: whole containers only, one per
    // identity, no journal, update file or staging leftover, death row emptied within
    // `deathRowWait`. Then compares each thread's model with what was found, reports what
    // no outcome allows, and narrows every expectation to what the disk shows (so later
    // operations build on the real state). Answers the violations found.
    std::vector<std::string> check(const std::vector<STWTortureModel*>& models,
                                   std::chrono::milliseconds deathRowWait = std::chrono::seconds(10));
    // The sandbox mapping store against the last scan: every mapping names a container of
    // its item type and points at it, and each of `mapped` (identities the daemon has been
    // asked for since it started) has its mapping.
    std::vector<std::string> checkMappings(const std::vector<STWTortureIdentity>& mapped) const;

    // What the last check() found, by identity (the first of duplicates).
    const std::map<STWTortureIdentity, Container>& found() const { return _found; }

    // Where the class directory of `containerClass` lies below the root ("" for none); a
    // per-user class's lies in `home`.
    static std::string classDirectory(uint64_t containerClass, const std::string& home = mobileHome);
    static bool isPerUser(uint64_t containerClass);
    static constexpr const char* mobileHome = "private/var/mobile";
    // The sandbox item type of a class (0 when it is never mapped).
    static uint64_t sandboxItemType(uint64_t containerClass);

    static constexpr const char* infoKey = "com.vorlane.torture.counter";

private:
    std::vector<std::string> _scan();
    // Scans one class directory; the containers of a per-user class must record `persona`
    // (for the mobile home: no enterprise persona).
    void _scanDirectory(uint64_t containerClass, const std::string& home, const std::string& persona,
                        std::vector<std::string>& violations);
    // Whether `c` records `persona` (empty: the personal one, i.e. no enterprise persona).
    bool _records(const Container& c, const std::string& persona) const;
    std::optional<Container> _readContainer(uint64_t containerClass, const std::string& directory,
                                            const std::string& name, std::string* problem) const;
    std::vector<std::string> _leftovers(std::chrono::milliseconds deathRowWait) const;
    std::string _path(const std::string& relative) const { return _root.string() + "/" + relative; }

    std::filesystem::path _root;
    std::map<STWTortureIdentity, Container> _found;
};

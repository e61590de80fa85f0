// Crash points: named places in multi-step disk changes where a test stops the daemon as a
// power cut would, to show that the next start finds every acknowledged container exactly
// once and nothing half-made.
//
// A point is armed in a daemon whose configuration says InternalImage, by the environment
// variable STOWLY_CRASH_AT="name" (the first pass) or "name:N" (the Nth pass); the daemon
// then SIGKILLs itself there, after flushing its log. Unarmed, a point costs one
// well-predicted branch on an atomic flag. In-process tests may install a handler that
// every point calls (it may throw, to test unwinding through the step).
//
// Every point is named here, so that tests can walk them all.
#pragma once

#include <array>
#include <atomic>
#include <functional>
#include <string_view>

namespace STWCrashPoint {

// Creation of a container: built in staging, published in its class directory, known to
// the cache.
inline constexpr const char* createAfterStaging = "create.after-staging";
inline constexpr const char* createAfterRename = "create.after-rename";
inline constexpr const char* createBeforeCacheAdd = "create.before-cache-add";

inline constexpr std::array<std::string_view, 3> creation = {createAfterStaging, createAfterRename,
                                                             createBeforeCacheAdd};
// A move to death row: its fresh "temp." directory made, the item not yet renamed into it.
inline constexpr const char* deathRowAfterTemporaryDirectory = "deathrow.after-temporary-directory";
// A death-row pass: the first item removed, the others not yet.
inline constexpr const char* deathRowAfterFirstItem = "deathrow.after-first-item";
// Deletion: a container renamed into death row, still in the cache.
inline constexpr const char* deleteAfterStaging = "delete.after-staging";

// Replace: the journal written; the old container parked in staging; the new one moved to
// its destination; the cache updated, staging and journal not yet sent to death row.
inline constexpr const char* replaceAfterJournal = "replace.after-journal";
inline constexpr const char* replaceAfterPark = "replace.after-park";
inline constexpr const char* replaceAfterMove = "replace.after-move";
inline constexpr const char* replaceBeforeCleanup = "replace.before-cleanup";

inline constexpr std::array<std::string_view, 4> replace = {replaceAfterJournal, replaceAfterPark, replaceAfterMove,
                                                            replaceBeforeCleanup};

// A protection-class change: its update file written; the container walked, the class not
// yet recorded in the metadata; the class recorded, the update file not yet removed.
inline constexpr const char* protectionAfterUpdateFile = "protection.after-update-file";
inline constexpr const char* protectionAfterWalk = "protection.after-walk";
inline constexpr const char* protectionAfterRecord = "protection.after-record";

inline constexpr std::array<std::string_view, 3> protection = {protectionAfterUpdateFile, protectionAfterWalk,
                                                               protectionAfterRecord};

// The build-upgrade migration of the first start after power-on: the old bundle directory
// renamed into the global layout; a well-known system container renamed to its well-known
// name, the cache not yet told.
inline constexpr const char* migrationAfterBundleMove = "migration.after-bundle-move";
inline constexpr const char* migrationAfterWellKnownMove = "migration.after-well-known-move";

inline constexpr std::array<std::string_view, 2> migration = {migrationAfterBundleMove, migrationAfterWellKnownMove};

// A code-signing update: the entry stored, the group containers it no longer names not yet
// sent to death row.
inline constexpr const char* codeSigningAfterUpdate = "codesigning.after-update";

inline constexpr std::array<std::string_view, 16> all = {
    createAfterStaging, createAfterRename,   createBeforeCacheAdd, deathRowAfterTemporaryDirectory,
    deathRowAfterFirstItem, deleteAfterStaging, replaceAfterJournal, replaceAfterPark,
    replaceAfterMove,   replaceBeforeCleanup, protectionAfterUpdateFile, protectionAfterWalk,
    protectionAfterRecord, migrationAfterBundleMove, migrationAfterWellKnownMove, codeSigningAfterUpdate};

extern std::atomic<bool> armed;
void _reached(const char* name);

inline void reach(const char* name) {
    if (__builtin_expect(armed.load(std::memory_order_relaxed), 0))
        _reached(name);
}

// Reads STOWLY_CRASH_AT once at start; ignored (with a log line) unless `internalImage`.
void armFromEnvironment(bool internalImage);
// Every point calls `handler` with its name while it is set (nullptr removes it).
void setHandlerForTesting(std::function<void(std::string_view name)> handler);

} // namespace STWCrashPoint

#define STW_CRASH_POINT(name) STWCrashPoint::reach(name)

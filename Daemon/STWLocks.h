// Identifier locks: the order of all container work.
//
// An operation on one container takes a reader/writer lock named by the container (its
// UUID string); an operation that changes the set of containers takes the daemon-wide
// lock. A daemon-wide writer excludes everything; a daemon-wide reader excludes
// per-identifier writers but not readers; locks of different identifiers never block
// each other. Several identifiers are always locked in ascending and released in
// descending order, so two multi-identifier lockers never deadlock. Broken invariants
// (unlocking what is not locked) stop the process.
#pragma once

#include <string>
#include <vector>

void lock_identifier_for_reading(const std::string& identifier);
void lock_identifier_for_reading(const std::vector<std::string>& identifiers);
void lock_identifier_for_writing(const std::string& identifier);
void lock_identifier_for_writing(const std::vector<std::string>& identifiers);
void unlock_identifier(const std::string& identifier);
void unlock_identifier(const std::vector<std::string>& identifiers);

void lock_all_identifiers_for_reading();
void lock_all_identifiers_for_writing();
void unlock_all_identifiers();

void take_one_lock(const std::string& identifier, bool write);
void unlock_one_lock(const std::string& identifier);

// What the lock state holds right now, for tests and diagnostics.
struct STWLocksSnapshot {
    uint32_t allReaderWriterState;
    uint32_t identifierReaderCount;
    uint32_t identifierWriterCount;
    size_t lockRecordCount;
};
STWLocksSnapshot STWLocksCurrentState();

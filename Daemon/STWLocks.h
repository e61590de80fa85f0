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

// Scoped holds: a lock taken in a scope is released on every way out of it, an exception
// included. Operations use these; the functions above are for holds that outlive one
// scope (the test locks keep the daemon-wide lock across requests).
enum class STWLockMode { Reading, Writing };

// The daemon-wide lock, or nothing when `use` is false (callers that already hold it).
class STWAllIdentifiersLockGuard {
public:
    explicit STWAllIdentifiersLockGuard(STWLockMode mode, bool use = true);
    ~STWAllIdentifiersLockGuard() { unlock(); }
    STWAllIdentifiersLockGuard(const STWAllIdentifiersLockGuard&) = delete;
    STWAllIdentifiersLockGuard& operator=(const STWAllIdentifiersLockGuard&) = delete;
    // Releases early; the destructor then does nothing.
    void unlock();

private:
    bool _held;
};

// The locks of one or several identifiers (taken in ascending order).
class STWIdentifierLockGuard {
public:
    STWIdentifierLockGuard(std::string identifier, STWLockMode mode);
    STWIdentifierLockGuard(std::vector<std::string> identifiers, STWLockMode mode);
    ~STWIdentifierLockGuard();
    STWIdentifierLockGuard(const STWIdentifierLockGuard&) = delete;
    STWIdentifierLockGuard& operator=(const STWIdentifierLockGuard&) = delete;

private:
    std::vector<std::string> _identifiers;
};

// What the lock state holds right now, for tests and diagnostics.
struct STWLocksSnapshot {
    uint32_t allReaderWriterState;
    uint32_t identifierReaderCount;
    uint32_t identifierWriterCount;
    size_t lockRecordCount;
};
STWLocksSnapshot STWLocksCurrentState();

// The persistent store behind the code-signing mapping: one STWCodeSigningEntry per
// code-signing identifier, kept in containers.sqlite3 in the daemon's library directory.
//
// A thin synchronous wrapper over one SQLite connection. It does no locking of its own:
// its only user, STWCodeSigningMapping, calls it from the mapping's serial queue. The
// connection holds the database file exclusively for the life of the process, so a second
// daemon pointed at the same library directory stops at open instead of sharing the file.
//
// Every operation reports failure through the optional error out-parameter with a code of
// STWErrorDomain: 38 missing argument, 40 exception caught, 66 database failure, 67
// identifier not in the database, 68 unexpected number of changed rows, 73 allocation
// failure. 67 and 68 are expected answers to the callers and are not logged. An empty
// identifier stands for a missing one.
#pragma once

#include "Daemon/CodeSigning/STWCodeSigningEntry.h"
#include "common/STWError.h"

#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

struct sqlite3;
struct sqlite3_stmt;

class STWSQLiteDB {
public:
    using EnumerationBlock =
        std::function<void(const std::string& identifier, const std::shared_ptr<STWCodeSigningEntry>& entry)>;

    // Opens (creating if needed) `parentDirectoryURL`/containers.sqlite3. A file that cannot
    // be opened or set up stops the daemon; nullptr only if no connection came back.
    static std::unique_ptr<STWSQLiteDB>
    initWithParentDirectoryURL(const std::filesystem::path& parentDirectoryURL);
    // Opens the file and runs the schema script; aborts the daemon on failure.
    static sqlite3* openDBWithURL(const std::filesystem::path& url);

    ~STWSQLiteDB();
    STWSQLiteDB(const STWSQLiteDB&) = delete;
    STWSQLiteDB& operator=(const STWSQLiteDB&) = delete;

    // Finalises the cached statements and closes the connection; runs on destruction.
    void closeDB();

    // Inserts or replaces the whole entry (flags, class, info dictionary) and links its
    // children to it, in one transaction. A child already linked to another parent moves
    // here; children missing from the entry's list keep their links.
    bool addCodeSigningEntry(const std::shared_ptr<const STWCodeSigningEntry>& entry,
                             const std::string& identifier, STWErrorRef* error);
    // True when exactly one entry was deleted; its data row and child links go with it.
    bool deleteCodeSigningEntryWithIdentifier(const std::string& identifier, STWErrorRef* error);
    // The stored entry with its child list (absent when it has none); 67 when not stored.
    std::shared_ptr<STWCodeSigningEntry> codeSigningEntryWithIdentifier(const std::string& identifier,
                                                                        STWErrorRef* error);
    // Marks the entry invalid; succeeds also when nothing is stored for the identifier.
    bool invalidateCodeSigningWithIdentifier(const std::string& identifier, STWErrorRef* error);
    // Invalidates the identifier and each of its children in one transaction.
    bool invalidateCodeSigningForIdentifierAndAllChildren(const std::string& identifier, STWErrorRef* error);
    // Calls `block` for every readable entry; unreadable rows are skipped. Returns nullptr
    // or the last error met; rows already delivered stay delivered.
    // Without `withChildren` the entries carry no child identifiers, which spares one query
    // per row (a walk that needs only the entitlements).
    STWErrorRef enumerateIdentifiersAndCodeSigningInfoUsingBlock(const EnumerationBlock& block,
                                                                 bool withChildren = true);
    // Every stored identifier; absent with no error when the database is empty.
    std::optional<std::vector<std::string>> identifiersWithError(STWErrorRef* error);
    // The parent's children in the order they were linked; 67 when it has none.
    std::optional<std::vector<std::string>> childIdentifiersForParentIdentifier(const std::string& identifier,
                                                                                STWErrorRef* error);
    // 67 when the identifier is nobody's child.
    std::optional<std::string> parentIdentifierForChildIdentifier(const std::string& identifier,
                                                                  STWErrorRef* error);
    // Removes every entry written ahead of an installation that never completed.
    bool deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(STWErrorRef* error);

    // The open connection (nullptr once closed) and the database file.
    sqlite3* db() const { return _db; }
    const std::filesystem::path& url() const { return _url; }

private:
    enum class _Query : uint8_t;
    class _Statement;
    struct _CachedStatement {
        sqlite3_stmt* statement = nullptr;
        bool inUse = false;
    };

    STWSQLiteDB(std::filesystem::path url, sqlite3* db);

    bool _sqliteExec(const char* sql, STWErrorRef* error);
    bool _performTwoParameterQuery(_Query query, const std::string& textInputOne,
                                   const std::string* textInputTwo, int expectedChanges, STWErrorRef* error);
    bool _performSingleParameterQuery(_Query query, const std::string& textInput, int expectedChanges,
                                      STWErrorRef* error);
    bool _performSingleParameterQuery(_Query query, const std::string& textInput, STWErrorRef* error);
    bool _performInsertOrUpdateQuery(_Query query, const STWCodeSigningEntry& entry,
                                     const std::string& identifier, bool isUpdate, STWErrorRef* error);
    bool _insertCodeSigningInfo(const STWCodeSigningEntry& entry, const std::string& identifier,
                                STWErrorRef* error);
    bool _insertCodeSigningData(const STWCodeSigningEntry& entry, const std::string& identifier,
                                STWErrorRef* error);
    bool _insertChildIdentifier(const std::string& childIdentifier, const std::string& parentIdentifier,
                                STWErrorRef* error);
    bool _deleteCodeSigningWithIdentifier(const std::string& identifier, STWErrorRef* error);
    std::shared_ptr<STWCodeSigningEntry> _selectCodeSigningEntryWithIdentifier(const std::string& identifier,
                                                                               STWErrorRef* error);
    // The child list; with `reportMissing` false a parent without children is no error (the
    // common case when reading entries, where building the "not found" error costs more
    // than the query).
    std::optional<std::vector<std::string>> _selectChildIdentifiers(const std::string& identifier,
                                                                    bool reportMissing, STWErrorRef* error);
    std::shared_ptr<STWCodeSigningEntry> _codeSigningEntryFromStatementRow(sqlite3_stmt* statement,
                                                                           STWErrorRef* error);
    // Runs "ROLLBACK;" after a failed or interrupted transaction; a failure is only logged.
    void _rollback();
    void _finalize(sqlite3_stmt* statement);

    sqlite3* _db = nullptr;
    std::filesystem::path _url;
    // One prepared statement per query, reused for the life of the connection.
    std::vector<_CachedStatement> _statements;
};

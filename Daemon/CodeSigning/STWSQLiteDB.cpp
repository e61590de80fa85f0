#include "Daemon/CodeSigning/STWSQLiteDB.h"

#include "common/STWException.h"
#include "common/STWLog.h"
#include "common/STWPropertyList.h"
#include "Daemon/Model/STWGlobalConfiguration.h"

#include <sqlite3.h>

#include <array>
#include <cstdlib>
#include <exception>
#include <new>

namespace {

// Runs on every open, exactly as the file format has always been set up. CREATE ... IF NOT
// EXISTS makes it a no-op on an existing file; the locking mode comes first so that the
// connection never shares the file. Note that switching a new file to WAL writes its
// header, so the auto_vacuum that follows no longer takes effect: files made by this
// script have auto-vacuum off (and have always had), which costs space, not correctness.
// clang-format off
constexpr const char* kSchemaScript =
    "PRAGMA locking_mode = EXCLUSIVE;"
    "PRAGMA journal_mode = WAL;"
    "PRAGMA foreign_keys = ON;"
    "PRAGMA auto_vacuum = FULL;"
    "CREATE TABLE IF NOT EXISTS code_signing_info("
        "id INTEGER PRIMARY KEY AUTOINCREMENT,"
        "code_signing_id_text TEXT NOT NULL UNIQUE,"
        "invalid INTEGER NOT NULL DEFAULT 0,"
        "placeholder INTEGER NOT NULL DEFAULT 0,"
        "registered_by_caller INTEGER NOT NULL DEFAULT 0,"
        "data_container_class INTEGER NOT NULL DEFAULT 0);"
    "CREATE TABLE IF NOT EXISTS code_signing_data("
        "id INTEGER PRIMARY KEY AUTOINCREMENT,"
        "cs_info_id INTEGER NOT NULL UNIQUE,"
        "data BLOB NOT NULL,"
        "FOREIGN KEY(cs_info_id) REFERENCES code_signing_info(id) ON DELETE CASCADE);"
    "CREATE TABLE IF NOT EXISTS child_bundles("
        "id INTEGER PRIMARY KEY AUTOINCREMENT,"
        "child_code_signing_id_text TEXT NOT NULL UNIQUE,"
        "parent_id INTEGER NOT NULL,"
        "FOREIGN KEY(parent_id) REFERENCES code_signing_info(id) ON DELETE CASCADE);"
    "CREATE INDEX IF NOT EXISTS code_signing_id_text_idx ON code_signing_info(code_signing_id_text);"
    "CREATE INDEX IF NOT EXISTS cs_info_id_idx ON code_signing_data(cs_info_id);"
    "CREATE INDEX IF NOT EXISTS parent_id_idx ON child_bundles(parent_id);";
// clang-format on

// Not part of the schema script, set in addition to it: the WAL journal alone may lose the
// last commits on power loss; with FULL every COMMIT is synced before we report success.
constexpr const char* kDurabilityPragmas = "PRAGMA synchronous = FULL;";

// The bit of the placeholder column that marks an advance copy.
constexpr int kAdvanceCopyFlag = 2;

} // namespace

enum class STWSQLiteDB::_Query : uint8_t {
    UpdateInfo,
    InsertInfo,
    InsertData,
    InsertChild,
    DeleteInfo,
    SelectEntry,
    SelectChildren,
    SelectParent,
    Invalidate,
    SelectAllEntries,
    SelectIdentifiers,
    DeleteAdvanceCopies,
    Count,
};

namespace {

enum class PrepareKind { Insert, Select, Delete };

struct QueryText {
    const char* sql;
    // Which prepare failure message names the statement.
    PrepareKind kind;
};

// Indexed by STWSQLiteDB::_Query, in the same order.
constexpr std::array<QueryText, 12> kQueries = {{
    {"UPDATE code_signing_info SET invalid=?, placeholder=?, registered_by_caller=?, data_container_class=? "
     "WHERE code_signing_id_text=?;",
     PrepareKind::Insert},
    {"INSERT INTO code_signing_info (invalid, placeholder, registered_by_caller, data_container_class, "
     "code_signing_id_text) VALUES (?, ?, ?, ?, ?);",
     PrepareKind::Insert},
    {"INSERT OR REPLACE INTO code_signing_data (cs_info_id, data) SELECT id, ? FROM code_signing_info WHERE "
     "code_signing_id_text = ?;",
     PrepareKind::Insert},
    {"INSERT OR REPLACE INTO child_bundles (parent_id, child_code_signing_id_text) SELECT id, ? FROM "
     "code_signing_info WHERE code_signing_id_text = ?;",
     PrepareKind::Insert},
    {"DELETE FROM code_signing_info WHERE code_signing_id_text=?;", PrepareKind::Delete},
    {"SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
     "code_signing_info.registered_by_caller, code_signing_info.data_container_class FROM code_signing_info, "
     "code_signing_data WHERE code_signing_info.id = code_signing_data.cs_info_id AND "
     "code_signing_info.code_signing_id_text = ?;",
     PrepareKind::Select},
    {"SELECT child_bundles.child_code_signing_id_text FROM child_bundles, code_signing_info WHERE "
     "code_signing_info.code_signing_id_text = ? AND child_bundles.parent_id=code_signing_info.id;",
     PrepareKind::Select},
    {"SELECT code_signing_info.code_signing_id_text FROM child_bundles, code_signing_info WHERE "
     "child_bundles.child_code_signing_id_text = ? AND child_bundles.parent_id=code_signing_info.id;",
     PrepareKind::Select},
    {"UPDATE code_signing_info SET invalid=1 WHERE code_signing_id_text = ?;", PrepareKind::Insert},
    {"SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
     "code_signing_info.registered_by_caller, code_signing_info.data_container_class, "
     "code_signing_info.code_signing_id_text FROM code_signing_info, code_signing_data WHERE "
     "code_signing_info.id = code_signing_data.cs_info_id;",
     PrepareKind::Select},
    {"SELECT code_signing_info.code_signing_id_text FROM code_signing_info;", PrepareKind::Select},
    {"DELETE FROM code_signing_info WHERE (placeholder & ?) > 0;", PrepareKind::Delete},
}};

// Internal builds log the uncaught-exception report of the catch site, so that an
// exception that should never happen can be traced back. The operation still fails with
// code 40 and its transaction is still rolled back; the daemon goes on.
STWErrorRef errorForCurrentException(const char* function, uint64_t line) {
    bool internal = STWGlobalConfiguration::sharedInstance()->isInternalImage();
    return STWErrorForCurrentException(function, line, internal ? STWExceptionReport::Log : STWExceptionReport::None);
}

#define STW_EXCEPTION_ERROR() errorForCurrentException(__func__, __LINE__)

} // namespace

// A prepared statement borrowed from the connection's cache for one use. Giving it back
// resets it and clears its bindings, so the next user starts from a fresh statement. A
// query that is already in use (an enumeration block that reads the database, say) gets a
// statement of its own, finalised when the handle goes.
class STWSQLiteDB::_Statement {
public:
    _Statement(STWSQLiteDB& owner, _Query query) : _owner(owner), _query(query) {
        static_assert(kQueries.size() == static_cast<size_t>(_Query::Count));
    }
    ~_Statement() {
        if (!_statement)
            return;
        if (_slot) {
            sqlite3_reset(_statement);
            sqlite3_clear_bindings(_statement);
            _slot->inUse = false;
        } else {
            _owner._finalize(_statement);
        }
    }
    _Statement(const _Statement&) = delete;
    _Statement& operator=(const _Statement&) = delete;

    int prepare() {
        _CachedStatement& slot = _owner._statements[static_cast<size_t>(_query)];
        if (!slot.inUse && slot.statement) {
            slot.inUse = true;
            _slot = &slot;
            _statement = slot.statement;
            return SQLITE_OK;
        }
        int rc = sqlite3_prepare_v2(_owner._db, text().sql, -1, &_statement, nullptr);
        if (rc != SQLITE_OK) {
            _owner._finalize(_statement);
            _statement = nullptr;
            return rc;
        }
        if (!slot.inUse) {
            slot.statement = _statement;
            slot.inUse = true;
            _slot = &slot;
        }
        return SQLITE_OK;
    }
    // The error for a failed prepare(), naming the kind of statement and its SQL.
    STWErrorRef prepareError(const char* function, uint64_t line) const {
        const char* format = "sqlite3_prepare(insert) for %@ failed: %s";
        if (text().kind == PrepareKind::Select)
            format = "sqlite3_prepare(select) for %@ failed: %s";
        else if (text().kind == PrepareKind::Delete)
            format = "sqlite3_prepare(delete) for %@ failed: %s";
        return STWErrorCreate(STWErrorDomain, STWErrorDatabase, function, line, nullptr, true, format,
                              text().sql, sqlite3_errmsg(_owner._db));
    }

    sqlite3_stmt* get() const { return _statement; }
    const char* sql() const { return text().sql; }

private:
    const QueryText& text() const { return kQueries[static_cast<size_t>(_query)]; }

    STWSQLiteDB& _owner;
    _Query _query;
    sqlite3_stmt* _statement = nullptr;
    _CachedStatement* _slot = nullptr;
};

STWSQLiteDB::STWSQLiteDB(std::filesystem::path url, sqlite3* db)
    : _db(db), _url(std::move(url)), _statements(static_cast<size_t>(_Query::Count)) {}

STWSQLiteDB::~STWSQLiteDB() {
    closeDB();
}

std::unique_ptr<STWSQLiteDB>
STWSQLiteDB::initWithParentDirectoryURL(const std::filesystem::path& parentDirectoryURL) {
    std::filesystem::path url = parentDirectoryURL / "containers";
    url.replace_extension("sqlite3");
    sqlite3* db = openDBWithURL(url);
    if (!db)
        return nullptr;
    return std::unique_ptr<STWSQLiteDB>(new STWSQLiteDB(std::move(url), db));
}

sqlite3* STWSQLiteDB::openDBWithURL(const std::filesystem::path& url) {
    sqlite3* db = nullptr;
    int rc = sqlite3_open_v2(url.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr);
    if (rc != SQLITE_OK) {
        STW_LOG_ERROR(STWLogCategory::Database, "opening %@ failed: %s", url, sqlite3_errmsg(db));
        sqlite3_close(db);
        STW_FATAL("Failed to open database, err = %d", rc);
    }
    // There is no recovery from a file we cannot set up (held by another daemon, not a
    // database, unwritable): serving without the mapping would hand out wrong entitlements.
    char* message = nullptr;
    rc = sqlite3_exec(db, kSchemaScript, nullptr, nullptr, &message);
    if (rc == SQLITE_OK)
        rc = sqlite3_exec(db, kDurabilityPragmas, nullptr, nullptr, &message);
    if (rc != SQLITE_OK) {
        STW_LOG_ERROR(STWLogCategory::Database, "table create for %@ failed: %s", url, message);
        sqlite3_free(message);
        sqlite3_close(db);
        STW_FATAL("Failed to initialize database, err = %d", rc);
    }
    STW_LOG_DEBUG(STWLogCategory::Database, "opening %@", url);
    return db;
}

void STWSQLiteDB::closeDB() {
    if (!_db)
        return;
    // Cached statements would keep the connection from closing.
    for (_CachedStatement& slot : _statements) {
        _finalize(slot.statement);
        slot = _CachedStatement();
    }
    STW_LOG_DEBUG(STWLogCategory::Database, "closing %@", _url);
    int rc = sqlite3_close(_db);
    if (rc != SQLITE_OK)
        STW_LOG_ERROR(STWLogCategory::Database, "sqlite3_close for %@ failed: %d", _url, rc);
    _db = nullptr;
}

void STWSQLiteDB::_finalize(sqlite3_stmt* statement) {
    if (!statement)
        return;
    if (sqlite3_finalize(statement) != SQLITE_OK)
        STW_LOG_ERROR(STWLogCategory::Database, "sqlite3_finalize for %@ failed: %s", _url,
                      sqlite3_errmsg(_db));
}

bool STWSQLiteDB::_sqliteExec(const char* sql, STWErrorRef* error) {
    char* message = nullptr;
    int rc = sqlite3_exec(_db, sql, nullptr, nullptr, &message);
    if (rc == SQLITE_OK)
        return true;
    STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr, "%@ on %@ failed: %s", sql, _url, message));
    sqlite3_free(message);
    return false;
}

void STWSQLiteDB::_rollback() {
    STWErrorRef error;
    if (!_sqliteExec("ROLLBACK;", &error))
        STW_ERROR(STWErrorDatabase, error, "failed _sqliteExec rollback");
}

bool STWSQLiteDB::_performTwoParameterQuery(_Query query, const std::string& textInputOne,
                                            const std::string* textInputTwo, int expectedChanges,
                                            STWErrorRef* error) {
    _Statement statement(*this, query);
    if (statement.prepare() != SQLITE_OK) {
        STWSetError(error, statement.prepareError(__func__, __LINE__));
        return false;
    }
    if (sqlite3_bind_text(statement.get(), 1, textInputOne.c_str(), -1, SQLITE_TRANSIENT) != SQLITE_OK) {
        STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr,
                                     "sqlite3_bind_text for identifier=%@ at %@ failed: %s", textInputOne,
                                     _url, sqlite3_errmsg(_db)));
        return false;
    }
    if (textInputTwo &&
        sqlite3_bind_text(statement.get(), 2, textInputTwo->c_str(), -1, SQLITE_TRANSIENT) != SQLITE_OK) {
        STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr,
                                     "sqlite3_bind_text for identifier=%@ at %@ failed: %s", *textInputTwo,
                                     _url, sqlite3_errmsg(_db)));
        return false;
    }
    if (sqlite3_step(statement.get()) != SQLITE_DONE) {
        STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s",
                                     statement.sql(), sqlite3_errmsg(_db)));
        return false;
    }
    if (expectedChanges == -1)
        return true;
    int changes = sqlite3_changes(_db);
    if (changes != expectedChanges) {
        STWSetError(error, STW_ERROR_NOLOG(STWErrorUnexpectedRowCount, nullptr,
                                           "sqlite3_changes for %s in %@: %d, but expecting %d",
                                           statement.sql(), _url, changes, expectedChanges));
        return false;
    }
    return true;
}

bool STWSQLiteDB::_performSingleParameterQuery(_Query query, const std::string& textInput,
                                               int expectedChanges, STWErrorRef* error) {
    return _performTwoParameterQuery(query, textInput, nullptr, expectedChanges, error);
}

bool STWSQLiteDB::_performSingleParameterQuery(_Query query, const std::string& textInput,
                                               STWErrorRef* error) {
    return _performSingleParameterQuery(query, textInput, -1, error);
}

bool STWSQLiteDB::_performInsertOrUpdateQuery(_Query query, const STWCodeSigningEntry& entry,
                                              const std::string& identifier, bool isUpdate,
                                              STWErrorRef* error) {
    _Statement statement(*this, query);
    if (statement.prepare() != SQLITE_OK) {
        STWSetError(error, statement.prepareError(__func__, __LINE__));
        return false;
    }
    sqlite3_stmt* stmt = statement.get();
    int invalid = entry.invalid() ? 1 : 0;
    if (sqlite3_bind_int(stmt, 1, invalid) != SQLITE_OK) {
        STWSetError(error,
                    STW_ERROR(STWErrorDatabase, nullptr, "sqlite3_bind_int for invalid=%d at %@ failed: %s",
                              invalid, _url, sqlite3_errmsg(_db)));
        return false;
    }
    int placeholder = entry.placeholder() ? 1 : 0;
    int advanceCopy = entry.advanceCopy() ? 1 : 0;
    int flags = placeholder | (advanceCopy ? kAdvanceCopyFlag : 0);
    if (sqlite3_bind_int(stmt, 2, flags) != SQLITE_OK) {
        STWSetError(
            error,
            STW_ERROR(STWErrorDatabase, nullptr,
                      "sqlite3_bind_int for placeholder=%d, advance_copy=%d (flags=%d) at %@ failed: %s",
                      placeholder, advanceCopy, flags, _url, sqlite3_errmsg(_db)));
        return false;
    }
    int registeredByCaller = entry.registeredByCaller() ? 1 : 0;
    if (sqlite3_bind_int(stmt, 3, registeredByCaller) != SQLITE_OK) {
        STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr,
                                     "sqlite3_bind_int for registered_by_caller=%d at %@ failed: %s",
                                     registeredByCaller, _url, sqlite3_errmsg(_db)));
        return false;
    }
    // Container classes are small numbers; the column holds the low 32 bits.
    int dataContainerClass = static_cast<int>(static_cast<uint32_t>(entry.dataContainerClass()));
    if (sqlite3_bind_int(stmt, 4, dataContainerClass) != SQLITE_OK) {
        STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr,
                                     "sqlite3_bind_int for data_container_class=%llu at %@ failed: %s",
                                     entry.dataContainerClass(), _url, sqlite3_errmsg(_db)));
        return false;
    }
    if (sqlite3_bind_text(stmt, 5, identifier.c_str(), -1, SQLITE_TRANSIENT) != SQLITE_OK) {
        STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr,
                                     "sqlite3_bind_text for code_signing_id_text=%@ at %@ failed: %s",
                                     identifier, _url, sqlite3_errmsg(_db)));
        return false;
    }
    if (sqlite3_step(stmt) != SQLITE_DONE) {
        STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s",
                                     statement.sql(), sqlite3_errmsg(_db)));
        return false;
    }
    // An UPDATE that matched no row is how a new identifier shows itself: the caller then
    // inserts, so this is not worth a log line.
    if (isUpdate) {
        int changes = sqlite3_changes(_db);
        if (changes != 1) {
            STWSetError(error, STW_ERROR_NOLOG(STWErrorUnexpectedRowCount, nullptr,
                                               "sqlite3_changes for %s in %@: %d, but expecting 1",
                                               statement.sql(), _url, changes));
            return false;
        }
    }
    return true;
}

bool STWSQLiteDB::_insertCodeSigningInfo(const STWCodeSigningEntry& entry, const std::string& identifier,
                                         STWErrorRef* error) {
    // Update first: an existing row keeps its id, which its data row and child links refer to.
    STWErrorRef updateError;
    if (_performInsertOrUpdateQuery(_Query::UpdateInfo, entry, identifier, true, &updateError))
        return true;
    if (!updateError->is(STWErrorUnexpectedRowCount)) {
        STWSetError(error, STW_ERROR(STWErrorDatabase, updateError,
                                     "Error performing UPDATE operation for %@", identifier));
        return false;
    }
    STWErrorRef insertError;
    if (!_performInsertOrUpdateQuery(_Query::InsertInfo, entry, identifier, false, &insertError)) {
        STWSetError(error, STW_ERROR(STWErrorDatabase, insertError,
                                     "Error performing INSERT operation for %@", identifier));
        return false;
    }
    return true;
}

bool STWSQLiteDB::_insertCodeSigningData(const STWCodeSigningEntry& entry, const std::string& identifier,
                                         STWErrorRef* error) {
    const auto& info = entry.codeSigningInfo();
    if (!info) {
        STWSetError(error,
                    STW_ERROR(STWErrorDatabase, nullptr,
                              "Failed to serialize code signing info for %@: the entry has no code signing "
                              "info dictionary",
                              identifier));
        return false;
    }
    std::string data = STWPropertyList::serializeBinary(STWValue(*info));
    if (data.empty()) {
        STWSetError(
            error,
            STW_ERROR(STWErrorDatabase, nullptr,
                      "Failed to serialize code signing info for %@: binary property list encoding failed",
                      identifier));
        return false;
    }
    _Statement statement(*this, _Query::InsertData);
    if (statement.prepare() != SQLITE_OK) {
        STWSetError(error, statement.prepareError(__func__, __LINE__));
        return false;
    }
    if (sqlite3_bind_blob64(statement.get(), 1, data.data(), data.size(), SQLITE_TRANSIENT) != SQLITE_OK) {
        STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr,
                                     "sqlite3_bind_blob64 for codeSigningInfoData at %@ failed: %s", _url,
                                     sqlite3_errmsg(_db)));
        return false;
    }
    if (sqlite3_bind_text(statement.get(), 2, identifier.c_str(), -1, SQLITE_TRANSIENT) != SQLITE_OK) {
        STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr,
                                     "sqlite3_bind_text for code_signing_id=%@ at %@ failed: %s", identifier,
                                     _url, sqlite3_errmsg(_db)));
        return false;
    }
    if (sqlite3_step(statement.get()) != SQLITE_DONE) {
        STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s",
                                     statement.sql(), sqlite3_errmsg(_db)));
        return false;
    }
    return true;
}

bool STWSQLiteDB::_insertChildIdentifier(const std::string& childIdentifier,
                                         const std::string& parentIdentifier, STWErrorRef* error) {
    return _performTwoParameterQuery(_Query::InsertChild, childIdentifier, &parentIdentifier, -1, error);
}

bool STWSQLiteDB::addCodeSigningEntry(const std::shared_ptr<const STWCodeSigningEntry>& entry,
                                      const std::string& identifier, STWErrorRef* error) {
    if (!entry || identifier.empty()) {
        STWSetError(error,
                    STW_ERROR(STWErrorInvalidArgument, nullptr,
                              "codeSigningEntry %@ and identifier %@ cannot be nil", entry, identifier));
        return false;
    }
    STWErrorRef failure;
    try {
        STWErrorRef execError;
        if (!_sqliteExec("BEGIN;", &execError)) {
            STWSetError(error, STW_ERROR(STWErrorDatabase, execError, "failed _sqliteExec begin"));
            return false;
        }
        if (_insertCodeSigningInfo(*entry, identifier, &failure) &&
            _insertCodeSigningData(*entry, identifier, &failure)) {
            // A child that cannot be linked must not cost the parent its entitlements.
            if (const auto& children = entry->childBundleIdentifiers()) {
                for (const std::string& child : *children) {
                    STWErrorRef childError;
                    _insertChildIdentifier(child, identifier, &childError);
                }
            }
            if (_sqliteExec("COMMIT;", &execError))
                return true;
            // A COMMIT that failed may leave the transaction open; roll it back so that the
            // next write can begin its own.
            failure = STW_ERROR(STWErrorDatabase, execError, "failed _sqliteExec commit");
        }
    } catch (...) {
        failure = STW_EXCEPTION_ERROR();
    }
    _rollback();
    STWSetError(error, failure);
    return false;
}

bool STWSQLiteDB::_deleteCodeSigningWithIdentifier(const std::string& identifier, STWErrorRef* error) {
    return _performSingleParameterQuery(_Query::DeleteInfo, identifier, 1, error);
}

bool STWSQLiteDB::deleteCodeSigningEntryWithIdentifier(const std::string& identifier, STWErrorRef* error) {
    if (identifier.empty()) {
        STWSetError(error,
                    STW_ERROR(STWErrorInvalidArgument, nullptr, "\bidentifier %@ cannot be nil", identifier));
        return false;
    }
    try {
        STWErrorRef deleteError;
        if (_deleteCodeSigningWithIdentifier(identifier, &deleteError))
            return true;
        STWSetError(error,
                    STW_ERROR(STWErrorDatabase, deleteError, "failed to delete from code_signing_info"));
    } catch (...) {
        STWSetError(error, STW_EXCEPTION_ERROR());
    }
    return false;
}

std::shared_ptr<STWCodeSigningEntry> STWSQLiteDB::_codeSigningEntryFromStatementRow(sqlite3_stmt* statement,
                                                                                    STWErrorRef* error) {
    const void* blob = sqlite3_column_blob(statement, 0);
    int length = sqlite3_column_bytes(statement, 0);
    if (!blob || length <= 0) {
        STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr,
                                     "Failed to create code signing entry from statement row"));
        return nullptr;
    }
    // Parsed straight from SQLite's buffer, which stays valid until the next step.
    std::optional<STWValue> info =
        STWPropertyList::parse(std::string_view(static_cast<const char*>(blob), static_cast<size_t>(length)));
    STWValue::Dictionary* dictionary = info ? info->mutableDictionary() : nullptr;
    if (!dictionary) {
        STWErrorRef corrupt =
            STWErrorCreate(STWGenericErrorDomain, STWGenericErrorCorruptFile, __func__, __LINE__, nullptr,
                           false, "The code signing info data is not a dictionary");
        STWSetError(error, STW_ERROR(STWErrorDatabase, corrupt, "Error formatting info data from DB"));
        return nullptr;
    }
    std::shared_ptr<STWCodeSigningEntry> entry;
    try {
        entry = std::make_shared<STWCodeSigningEntry>(std::move(*dictionary));
    } catch (const std::bad_alloc&) {
        STWSetError(error,
                    STW_ERROR(STWErrorAllocationFailed, nullptr, "Failed to allocate codeSigningEntry"));
        return nullptr;
    }
    int flags = sqlite3_column_int(statement, 2);
    entry->setInvalid(sqlite3_column_int(statement, 1) != 0);
    entry->setPlaceholder((flags & 1) != 0);
    entry->setAdvanceCopy((flags & kAdvanceCopyFlag) != 0);
    entry->setRegisteredByCaller(sqlite3_column_int(statement, 3) != 0);
    // Written as the low 32 bits; read back unsigned so that no class turns negative.
    entry->setDataContainerClass(static_cast<uint32_t>(sqlite3_column_int(statement, 4)));
    return entry;
}

std::shared_ptr<STWCodeSigningEntry>
STWSQLiteDB::_selectCodeSigningEntryWithIdentifier(const std::string& identifier, STWErrorRef* error) {
    _Statement statement(*this, _Query::SelectEntry);
    if (statement.prepare() != SQLITE_OK) {
        STWSetError(error, statement.prepareError(__func__, __LINE__));
        return nullptr;
    }
    if (sqlite3_bind_text(statement.get(), 1, identifier.c_str(), -1, SQLITE_TRANSIENT) != SQLITE_OK) {
        STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr,
                                     "sqlite3_bind_text for code_signing_id_text=%@ at %@ failed: %s",
                                     identifier, _url, sqlite3_errmsg(_db)));
        return nullptr;
    }
    int rc = sqlite3_step(statement.get());
    if (rc == SQLITE_ROW)
        return _codeSigningEntryFromStatementRow(statement.get(), error);
    if (rc == SQLITE_DONE)
        STWSetError(error, STW_ERROR_NOLOG(STWErrorIdentifierNotInDatabase, nullptr,
                                           "Identifier: \"%@\" Not Found in DB", identifier));
    else
        STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s",
                                     statement.sql(), sqlite3_errmsg(_db)));
    return nullptr;
}

std::shared_ptr<STWCodeSigningEntry>
STWSQLiteDB::codeSigningEntryWithIdentifier(const std::string& identifier, STWErrorRef* error) {
    try {
        STWErrorRef selectError;
        std::shared_ptr<STWCodeSigningEntry> entry =
            _selectCodeSigningEntryWithIdentifier(identifier, &selectError);
        if (!entry) {
            // A miss is an ordinary answer (every new identifier starts with one).
            if (selectError->is(STWErrorIdentifierNotInDatabase))
                STW_LOG_DEBUG(STWLogCategory::Database, "Error retrieving code signing entry: %@",
                              selectError);
            else
                STW_LOG_ERROR(STWLogCategory::Database, "Error retrieving code signing entry: %@",
                              selectError);
            STWSetError(error, selectError);
            return nullptr;
        }
        STWErrorRef childError;
        std::optional<std::vector<std::string>> children =
            _selectChildIdentifiers(identifier, false, &childError);
        if (children) {
            entry->setChildBundleIdentifiers(std::move(children));
        } else if (childError) {
            STW_LOG_ERROR(STWLogCategory::Database, "Error retrieving childBundleIds: %@", childError);
            STWSetError(error, childError);
            return nullptr;
        }
        return entry;
    } catch (...) {
        STWSetError(error, STW_EXCEPTION_ERROR());
        return nullptr;
    }
}

std::optional<std::vector<std::string>>
STWSQLiteDB::childIdentifiersForParentIdentifier(const std::string& identifier, STWErrorRef* error) {
    return _selectChildIdentifiers(identifier, true, error);
}

std::optional<std::vector<std::string>>
STWSQLiteDB::_selectChildIdentifiers(const std::string& identifier, bool reportMissing, STWErrorRef* error) {
    try {
        _Statement statement(*this, _Query::SelectChildren);
        if (statement.prepare() != SQLITE_OK) {
            STWSetError(error, statement.prepareError(__func__, __LINE__));
            return std::nullopt;
        }
        if (sqlite3_bind_text(statement.get(), 1, identifier.c_str(), -1, SQLITE_TRANSIENT) != SQLITE_OK) {
            STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr,
                                         "sqlite3_bind_text for code_signing_id_text=%@ at %@ failed: %s",
                                         identifier, _url, sqlite3_errmsg(_db)));
            return std::nullopt;
        }
        std::vector<std::string> children;
        int rc;
        while ((rc = sqlite3_step(statement.get())) == SQLITE_ROW) {
            const char* text = reinterpret_cast<const char*>(sqlite3_column_text(statement.get(), 0));
            if (!text)
                continue;
            try {
                children.emplace_back(text);
            } catch (const std::bad_alloc&) {
                STWSetError(error, STW_ERROR(STWErrorAllocationFailed, nullptr,
                                             "Failed to allocate thisChildBundleId for text: %s", text));
                return std::nullopt;
            }
        }
        if (rc != SQLITE_DONE) {
            STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s",
                                         statement.sql(), sqlite3_errmsg(_db)));
            return std::nullopt;
        }
        if (children.empty()) {
            if (!reportMissing)
                return std::nullopt;
            STWSetError(error, STW_ERROR_NOLOG(STWErrorIdentifierNotInDatabase, nullptr,
                                               "Children for parent identifier: \"%@\" Not Found in DB",
                                               identifier));
            return std::nullopt;
        }
        return children;
    } catch (const std::bad_alloc&) {
        STWSetError(error, STW_ERROR(STWErrorAllocationFailed, nullptr, "Failed to allocate childBundleIds"));
    } catch (...) {
        STWSetError(error, STW_EXCEPTION_ERROR());
    }
    return std::nullopt;
}

std::optional<std::string> STWSQLiteDB::parentIdentifierForChildIdentifier(const std::string& identifier,
                                                                           STWErrorRef* error) {
    try {
        _Statement statement(*this, _Query::SelectParent);
        if (statement.prepare() != SQLITE_OK) {
            STWSetError(error, statement.prepareError(__func__, __LINE__));
            return std::nullopt;
        }
        if (sqlite3_bind_text(statement.get(), 1, identifier.c_str(), -1, SQLITE_TRANSIENT) != SQLITE_OK) {
            STWSetError(error,
                        STW_ERROR(STWErrorDatabase, nullptr,
                                  "sqlite3_bind_text for child_code_signing_id_text=%@ at %@ failed: %s",
                                  identifier, _url, sqlite3_errmsg(_db)));
            return std::nullopt;
        }
        std::optional<std::string> parent;
        int rc;
        while ((rc = sqlite3_step(statement.get())) == SQLITE_ROW) {
            const char* text = reinterpret_cast<const char*>(sqlite3_column_text(statement.get(), 0));
            if (!text)
                continue;
            try {
                parent = text;
            } catch (const std::bad_alloc&) {
                STWSetError(error, STW_ERROR(STWErrorAllocationFailed, nullptr,
                                             "Failed to allocate parentIdentifier for text: %s", text));
                return std::nullopt;
            }
        }
        if (rc != SQLITE_DONE) {
            STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s",
                                         statement.sql(), sqlite3_errmsg(_db)));
            return std::nullopt;
        }
        if (!parent)
            STWSetError(error, STW_ERROR_NOLOG(STWErrorIdentifierNotInDatabase, nullptr,
                                               "Parent identifier for: \"%@\" Not Found in DB", identifier));
        return parent;
    } catch (...) {
        STWSetError(error, STW_EXCEPTION_ERROR());
    }
    return std::nullopt;
}

bool STWSQLiteDB::invalidateCodeSigningWithIdentifier(const std::string& identifier, STWErrorRef* error) {
    try {
        STWErrorRef updateError;
        if (_performSingleParameterQuery(_Query::Invalidate, identifier, &updateError))
            return true;
        STWSetError(error, STW_ERROR(STWErrorDatabase, updateError, "failed to invalidate identifier %@",
                                     identifier));
    } catch (...) {
        STWSetError(error, STW_EXCEPTION_ERROR());
    }
    return false;
}

bool STWSQLiteDB::invalidateCodeSigningForIdentifierAndAllChildren(const std::string& identifier,
                                                                   STWErrorRef* error) {
    STWErrorRef failure;
    try {
        STWErrorRef childError;
        std::optional<std::vector<std::string>> children =
            _selectChildIdentifiers(identifier, false, &childError);
        if (!children && childError) {
            STWSetError(error, STW_ERROR(STWErrorDatabase, childError,
                                         "Error retrieving child bundles ids from DB with identifier %@ : %@",
                                         identifier, childError));
            return false;
        }
        std::vector<std::string> family{identifier};
        if (children)
            family.insert(family.end(), children->begin(), children->end());

        STWErrorRef execError;
        if (!_sqliteExec("BEGIN;", &execError)) {
            STWSetError(error, STW_ERROR(STWErrorDatabase, execError, "failed _sqliteExec begin"));
            return false;
        }
        for (const std::string& member : family) {
            STWErrorRef invalidateError;
            if (invalidateCodeSigningWithIdentifier(member, &invalidateError))
                STW_LOG_DEBUG(STWLogCategory::Database, "Invalidating code signing info for %@ child: %@",
                              identifier, member);
            else
                STW_LOG_ERROR(STWLogCategory::Database,
                              "Failed to invalidate code signing info for %@ child %@ : %@", identifier,
                              member, invalidateError);
        }
        if (_sqliteExec("COMMIT;", &execError))
            return true;
        failure = STW_ERROR(STWErrorDatabase, execError, "failed _sqliteExec commit");
    } catch (...) {
        failure = STW_EXCEPTION_ERROR();
    }
    _rollback();
    STWSetError(error, failure);
    return false;
}

STWErrorRef STWSQLiteDB::enumerateIdentifiersAndCodeSigningInfoUsingBlock(const EnumerationBlock& block,
                                                                            bool withChildren) {
    STWErrorRef lastError;
    try {
        _Statement statement(*this, _Query::SelectAllEntries);
        if (statement.prepare() != SQLITE_OK)
            return statement.prepareError(__func__, __LINE__);
        int rc;
        while ((rc = sqlite3_step(statement.get())) == SQLITE_ROW) {
            // One bad row must not hide the others: record its error and go on.
            STWErrorRef rowError;
            std::shared_ptr<STWCodeSigningEntry> entry =
                _codeSigningEntryFromStatementRow(statement.get(), &rowError);
            if (!entry) {
                lastError = rowError;
                continue;
            }
            const char* text = reinterpret_cast<const char*>(sqlite3_column_text(statement.get(), 5));
            if (!text) {
                lastError =
                    STW_ERROR(STWErrorDatabase, nullptr, "Error retrieving code_signing_id_text from DB");
                continue;
            }
            std::string identifier;
            try {
                identifier = text;
            } catch (const std::bad_alloc&) {
                lastError = STW_ERROR(STWErrorAllocationFailed, nullptr,
                                      "Failed to allocate identifier for text: %s", text);
                break;
            }
            STWErrorRef childError;
            std::optional<std::vector<std::string>> children;
            if (withChildren)
                children = _selectChildIdentifiers(identifier, false, &childError);
            if (children) {
                entry->setChildBundleIdentifiers(std::move(children));
            } else if (childError) {
                lastError = STW_ERROR(STWErrorDatabase, childError, "Error retrieving childBundleIds: %@",
                                      childError);
                continue;
            }
            block(identifier, entry);
        }
        if (rc != SQLITE_ROW && rc != SQLITE_DONE)
            lastError = STW_ERROR(STWErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s",
                                  statement.sql(), sqlite3_errmsg(_db));
    } catch (...) {
        lastError = STW_EXCEPTION_ERROR();
    }
    return lastError;
}

std::optional<std::vector<std::string>> STWSQLiteDB::identifiersWithError(STWErrorRef* error) {
    STWErrorRef metError;
    std::vector<std::string> identifiers;
    try {
        _Statement statement(*this, _Query::SelectIdentifiers);
        if (statement.prepare() != SQLITE_OK) {
            STWSetError(error, statement.prepareError(__func__, __LINE__));
            return std::nullopt;
        }
        int rc;
        while ((rc = sqlite3_step(statement.get())) == SQLITE_ROW) {
            const char* text = reinterpret_cast<const char*>(sqlite3_column_text(statement.get(), 0));
            if (!text) {
                metError =
                    STW_ERROR(STWErrorDatabase, nullptr, "Error retrieving code_signing_id_text from DB");
                continue;
            }
            identifiers.emplace_back(text);
        }
        if (rc != SQLITE_DONE)
            metError = STW_ERROR(STWErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s", statement.sql(),
                                 sqlite3_errmsg(_db));
    } catch (...) {
        metError = STW_EXCEPTION_ERROR();
        identifiers.clear();
    }
    if (identifiers.empty()) {
        // An empty table is an answer, not a failure: the caller gets no error then.
        STWSetError(error, metError);
        return std::nullopt;
    }
    return identifiers;
}

bool STWSQLiteDB::deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(STWErrorRef* error) {
    try {
        _Statement statement(*this, _Query::DeleteAdvanceCopies);
        if (statement.prepare() != SQLITE_OK) {
            STWSetError(error, statement.prepareError(__func__, __LINE__));
            return false;
        }
        if (sqlite3_bind_int(statement.get(), 1, kAdvanceCopyFlag) != SQLITE_OK) {
            STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr,
                                         "sqlite3_bind_text for flags=%d at %@ failed: %s", kAdvanceCopyFlag,
                                         _url, sqlite3_errmsg(_db)));
            return false;
        }
        if (sqlite3_step(statement.get()) != SQLITE_DONE) {
            STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr, "sqlite3_step for %@ failed: %s",
                                         statement.sql(), sqlite3_errmsg(_db)));
            return false;
        }
        int deleted = sqlite3_changes(_db);
        if (deleted > 0)
            STW_LOG_NOTICE(STWLogCategory::Database, "Deleted %d advance copies of code signing info.",
                           deleted);
        return true;
    } catch (...) {
        STWSetError(error, STW_EXCEPTION_ERROR());
    }
    return false;
}

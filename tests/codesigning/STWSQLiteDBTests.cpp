#include "Daemon/CodeSigning/STWSQLiteDB.h"

#include "Daemon/Model/STWGlobalConfiguration.h"
#include "common/STWFileIO.h"
#include "common/STWLog.h"
#include "common/STWPropertyList.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <sqlite3.h>

#include <algorithm>
#include <csignal>
#include <fstream>
#include <stdexcept>
#include <sys/wait.h>
#include <unistd.h>

namespace {

std::shared_ptr<STWCodeSigningEntry> makeEntry(const std::string& group, uint64_t dataContainerClass = 2) {
    STWValue::Dictionary entitlements{
        {"com.vorlane.security.application-groups", STWValue(STWValue::Array{STWValue(group)})}};
    STWValue::Dictionary info{{"com.vorlane.Stowly.Entitlements", STWValue(std::move(entitlements))}};
    return std::make_shared<STWCodeSigningEntry>(std::move(info), dataContainerClass);
}

std::vector<std::string> sorted(std::vector<std::string> v) {
    std::sort(v.begin(), v.end());
    return v;
}

class STWSQLiteDBTest : public ::testing::Test {
protected:
    void SetUp() override {
        char templ[] = "/tmp/stowly-csdb-XXXXXX";
        ASSERT_NE(mkdtemp(templ), nullptr);
        dir = templ;
        db = STWSQLiteDB::initWithParentDirectoryURL(dir);
        ASSERT_TRUE(db);
    }
    void TearDown() override {
        db.reset();
        std::filesystem::remove_all(dir);
    }

    void add(const std::shared_ptr<STWCodeSigningEntry>& entry, const std::string& identifier) {
        STWErrorRef error;
        ASSERT_TRUE(db->addCodeSigningEntry(entry, identifier, &error)) << error->description();
        EXPECT_FALSE(error);
    }
    std::shared_ptr<STWCodeSigningEntry> read(const std::string& identifier) {
        STWErrorRef error;
        auto entry = db->codeSigningEntryWithIdentifier(identifier, &error);
        EXPECT_TRUE(entry) << identifier << ": " << (error ? error->description() : "no error");
        return entry;
    }
    // One integer straight from the file, to see what was stored rather than what is read back.
    int64_t queryInt(const std::string& sql) {
        sqlite3_stmt* statement = nullptr;
        EXPECT_EQ(sqlite3_prepare_v2(db->db(), sql.c_str(), -1, &statement, nullptr), SQLITE_OK) << sql;
        EXPECT_EQ(sqlite3_step(statement), SQLITE_ROW) << sql;
        int64_t value = sqlite3_column_int64(statement, 0);
        sqlite3_finalize(statement);
        return value;
    }
    void replaceData(const std::string& identifier, const std::string& bytes) {
        sqlite3_stmt* statement = nullptr;
        ASSERT_EQ(
            sqlite3_prepare_v2(db->db(),
                               "UPDATE code_signing_data SET data = ? WHERE cs_info_id = (SELECT id FROM "
                               "code_signing_info WHERE code_signing_id_text = ?);",
                               -1, &statement, nullptr),
            SQLITE_OK);
        sqlite3_bind_blob(statement, 1, bytes.data(), static_cast<int>(bytes.size()), SQLITE_TRANSIENT);
        sqlite3_bind_text(statement, 2, identifier.c_str(), -1, SQLITE_TRANSIENT);
        EXPECT_EQ(sqlite3_step(statement), SQLITE_DONE);
        EXPECT_EQ(sqlite3_changes(db->db()), 1);
        sqlite3_finalize(statement);
    }
    std::vector<std::string> identifiers() {
        STWErrorRef error;
        auto ids = db->identifiersWithError(&error);
        EXPECT_FALSE(error);
        return ids ? sorted(*ids) : std::vector<std::string>();
    }

    std::filesystem::path dir;
    std::unique_ptr<STWSQLiteDB> db;
};

TEST_F(STWSQLiteDBTest, FirstWriteInsertsAndRewriteUpdatesTheSameRow) {
    auto first = makeEntry("group.first", 7);
    first->setInvalid(true);
    first->setRegisteredByCaller(true);
    add(first, "com.example.app");
    auto stored = read("com.example.app");
    ASSERT_TRUE(stored);
    EXPECT_EQ(*stored, *first) << stored->description();
    int64_t rowID =
        queryInt("SELECT id FROM code_signing_info WHERE code_signing_id_text = 'com.example.app';");

    auto second = makeEntry("group.second", 3);
    second->setPlaceholder(true);
    add(second, "com.example.app");
    stored = read("com.example.app");
    ASSERT_TRUE(stored);
    EXPECT_EQ(*stored, *second) << stored->description();
    EXPECT_EQ(queryInt("SELECT id FROM code_signing_info WHERE code_signing_id_text = 'com.example.app';"),
              rowID);
    EXPECT_EQ(queryInt("SELECT count(*) FROM code_signing_info;"), 1);
    EXPECT_EQ(queryInt("SELECT count(*) FROM code_signing_data;"), 1);
}

// The statements the connection runs, as SQLite saw them.
class StatementTrace {
public:
    explicit StatementTrace(sqlite3* db) : _db(db) {
        sqlite3_trace_v2(
            _db, SQLITE_TRACE_STMT,
            [](unsigned, void* context, void* statement, void*) {
                static_cast<StatementTrace*>(context)->_statements.push_back(
                    sqlite3_sql(static_cast<sqlite3_stmt*>(statement)));
                return 0;
            },
            this);
    }
    ~StatementTrace() { sqlite3_trace_v2(_db, 0, nullptr, nullptr); }
    // The first word of each statement, and for writes the table too: "UPDATE code_signing_info".
    std::vector<std::string> take() {
        std::vector<std::string> summary;
        for (const std::string& sql : _statements) {
            std::string words = sql.substr(0, sql.find(" ("));
            if (words.rfind("INSERT OR REPLACE INTO ", 0) == 0 || words.rfind("INSERT INTO ", 0) == 0)
                words = words.substr(0, words.find(' ', words.find("INTO ") + 5));
            else if (words.rfind("UPDATE ", 0) == 0)
                words = words.substr(0, words.find(" SET"));
            else
                words = words.substr(0, words.find(' '));
            summary.push_back(words);
        }
        _statements.clear();
        return summary;
    }

private:
    sqlite3* _db;
    std::vector<std::string> _statements;
};

TEST_F(STWSQLiteDBTest, ANewIdentifierIsInsertedAfterAnUpdateThatMatchedNothing) {
    StatementTrace trace(db->db());
    add(makeEntry("group.one"), "com.example.app");
    EXPECT_EQ(trace.take(), (std::vector<std::string>{"BEGIN;", "UPDATE code_signing_info", "INSERT INTO code_signing_info",
                                                      "INSERT OR REPLACE INTO code_signing_data", "COMMIT;"}));
    auto second = makeEntry("group.two");
    second->setChildBundleIdentifiers(std::vector<std::string>{"com.example.app.widget"});
    add(second, "com.example.app");
    EXPECT_EQ(trace.take(),
              (std::vector<std::string>{"BEGIN;", "UPDATE code_signing_info", "INSERT OR REPLACE INTO code_signing_data",
                                        "INSERT OR REPLACE INTO child_bundles", "COMMIT;"}));
}

TEST_F(STWSQLiteDBTest, TheConnectionHoldsAFullySyncedWriteAheadLog) {
    sqlite3_stmt* statement = nullptr;
    ASSERT_EQ(sqlite3_prepare_v2(db->db(), "PRAGMA journal_mode;", -1, &statement, nullptr), SQLITE_OK);
    ASSERT_EQ(sqlite3_step(statement), SQLITE_ROW);
    EXPECT_STREQ(reinterpret_cast<const char*>(sqlite3_column_text(statement, 0)), "wal");
    sqlite3_finalize(statement);
    EXPECT_EQ(queryInt("PRAGMA synchronous;"), 2); // FULL
    EXPECT_EQ(queryInt("PRAGMA foreign_keys;"), 1);
}

TEST_F(STWSQLiteDBTest, FailedWriteLeavesNoTraceAndTheNextWriteWorks) {
    // An entry without an info dictionary cannot be stored: the info row written before
    // the failure must go with the rolled-back transaction.
    auto empty = std::make_shared<STWCodeSigningEntry>();
    STWErrorRef error;
    EXPECT_FALSE(db->addCodeSigningEntry(empty, "com.example.new", &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(STWErrorDatabase));
    EXPECT_TRUE(identifiers().empty());

    auto original = makeEntry("group.kept");
    add(original, "com.example.app");
    auto broken = std::make_shared<STWCodeSigningEntry>();
    broken->setInvalid(true);
    EXPECT_FALSE(db->addCodeSigningEntry(broken, "com.example.app", nullptr));
    auto stored = read("com.example.app");
    ASSERT_TRUE(stored);
    EXPECT_EQ(*stored, *original);

    error = nullptr;
    EXPECT_FALSE(db->addCodeSigningEntry(nullptr, "com.example.app", &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(STWErrorInvalidArgument));
    add(makeEntry("group.after"), "com.example.after");
    EXPECT_EQ(identifiers(), (std::vector<std::string>{"com.example.after", "com.example.app"}));
}

TEST_F(STWSQLiteDBTest, AdvanceCopyPurgeKeepsPlainPlaceholders) {
    auto both = makeEntry("group.both");
    both->setPlaceholder(true);
    both->setAdvanceCopy(true);
    both->setChildBundleIdentifiers(std::vector<std::string>{"com.example.both.widget"});
    auto advanceOnly = makeEntry("group.advance");
    advanceOnly->setAdvanceCopy(true);
    auto placeholderOnly = makeEntry("group.placeholder");
    placeholderOnly->setPlaceholder(true);
    add(both, "com.example.both");
    add(advanceOnly, "com.example.advance");
    add(placeholderOnly, "com.example.placeholder");
    add(makeEntry("group.plain"), "com.example.plain");

    EXPECT_EQ(
        queryInt(
            "SELECT placeholder FROM code_signing_info WHERE code_signing_id_text = 'com.example.both';"),
        3);
    auto stored = read("com.example.both");
    ASSERT_TRUE(stored);
    EXPECT_EQ(*stored, *both);

    STWErrorRef error;
    ASSERT_TRUE(db->deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(&error)) << error->description();
    EXPECT_EQ(identifiers(), (std::vector<std::string>{"com.example.placeholder", "com.example.plain"}));
    stored = read("com.example.placeholder");
    ASSERT_TRUE(stored);
    EXPECT_EQ(*stored, *placeholderOnly);
    EXPECT_EQ(queryInt("SELECT count(*) FROM code_signing_data;"), 2);
    EXPECT_FALSE(db->parentIdentifierForChildIdentifier("com.example.both.widget", nullptr));
}

TEST_F(STWSQLiteDBTest, MissingIdentifiersOnDeleteAndInvalidate) {
    STWErrorRef error;
    EXPECT_FALSE(db->deleteCodeSigningEntryWithIdentifier("com.example.missing", &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(STWErrorDatabase));
    ASSERT_TRUE(error->underlyingError());
    EXPECT_TRUE(error->underlyingError()->is(STWErrorUnexpectedRowCount));

    error = nullptr;
    EXPECT_TRUE(db->invalidateCodeSigningWithIdentifier("com.example.missing", &error));
    EXPECT_TRUE(db->invalidateCodeSigningForIdentifierAndAllChildren("com.example.missing", &error));
    EXPECT_FALSE(error);
    EXPECT_TRUE(identifiers().empty());

    add(makeEntry("group.present"), "com.example.present");
    ASSERT_TRUE(db->invalidateCodeSigningWithIdentifier("com.example.present", &error));
    auto stored = read("com.example.present");
    ASSERT_TRUE(stored);
    EXPECT_TRUE(stored->invalid());
    EXPECT_TRUE(db->deleteCodeSigningEntryWithIdentifier("com.example.present", &error));
    EXPECT_FALSE(db->codeSigningEntryWithIdentifier("com.example.present", &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(STWErrorIdentifierNotInDatabase));
}

TEST_F(STWSQLiteDBTest, ChildrenKeepTheirOrderMoveBetweenParentsAndGoWithTheirParent) {
    // Not in alphabetical order, so that an ordering by text would show.
    std::vector<std::string> children{"com.example.a.widget", "com.example.a.share", "com.example.a.intents"};
    auto parentA = makeEntry("group.a");
    parentA->setChildBundleIdentifiers(children);
    add(parentA, "com.example.a");
    add(makeEntry("group.a"), "com.example.a.share");
    add(makeEntry("group.a"), "com.example.a.intents");

    STWErrorRef error;
    auto listed = db->childIdentifiersForParentIdentifier("com.example.a", &error);
    ASSERT_TRUE(listed) << error->description();
    EXPECT_EQ(*listed, children);
    auto stored = read("com.example.a");
    ASSERT_TRUE(stored);
    EXPECT_EQ(*stored, *parentA);
    auto child = read("com.example.a.share");
    ASSERT_TRUE(child);
    EXPECT_FALSE(child->childBundleIdentifiers());

    auto parentB = makeEntry("group.b");
    parentB->setChildBundleIdentifiers(std::vector<std::string>{"com.example.a.share"});
    add(parentB, "com.example.b");
    EXPECT_EQ(db->parentIdentifierForChildIdentifier("com.example.a.share", &error), "com.example.b");
    listed = db->childIdentifiersForParentIdentifier("com.example.a", &error);
    ASSERT_TRUE(listed);
    EXPECT_EQ(*listed, (std::vector<std::string>{"com.example.a.widget", "com.example.a.intents"}));

    // The family is A and its remaining children; the moved child belongs to B now.
    ASSERT_TRUE(db->invalidateCodeSigningForIdentifierAndAllChildren("com.example.a", &error));
    EXPECT_TRUE(read("com.example.a")->invalid());
    EXPECT_TRUE(read("com.example.a.intents")->invalid());
    EXPECT_FALSE(read("com.example.a.share")->invalid());

    ASSERT_TRUE(db->deleteCodeSigningEntryWithIdentifier("com.example.a", &error));
    error = nullptr;
    EXPECT_FALSE(db->parentIdentifierForChildIdentifier("com.example.a.intents", &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(STWErrorIdentifierNotInDatabase));
    EXPECT_FALSE(db->childIdentifiersForParentIdentifier("com.example.a", nullptr));
    EXPECT_TRUE(read("com.example.a.intents"));
    EXPECT_EQ(identifiers(),
              (std::vector<std::string>{"com.example.a.intents", "com.example.a.share", "com.example.b"}));
    EXPECT_EQ(queryInt("SELECT count(*) FROM code_signing_data;"), 3);
    EXPECT_EQ(queryInt("SELECT count(*) FROM child_bundles;"), 1);
}

TEST_F(STWSQLiteDBTest, UnreadableDataIsReportedAndSkippedByEnumeration) {
    auto good = makeEntry("group.good");
    good->setChildBundleIdentifiers(std::vector<std::string>{"com.example.good.widget"});
    add(good, "com.example.good");
    add(makeEntry("group.array"), "com.example.array");
    add(makeEntry("group.garbage"), "com.example.garbage");
    auto other = makeEntry("group.other", 5);
    add(other, "com.example.other");
    replaceData("com.example.array", STWPropertyList::serializeBinary(
                                         STWValue(STWValue::Array{STWValue("not"), STWValue("a dict")})));
    replaceData("com.example.garbage", std::string("\x00\x01\x02\x03garbage", 11));

    STWErrorRef error;
    EXPECT_FALSE(db->codeSigningEntryWithIdentifier("com.example.array", &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(STWErrorDatabase));
    ASSERT_TRUE(error->underlyingError());
    EXPECT_EQ(error->underlyingError()->domain(), STWGenericErrorDomain);
    EXPECT_EQ(error->underlyingError()->code(), STWGenericErrorCorruptFile);
    error = nullptr;
    EXPECT_FALSE(db->codeSigningEntryWithIdentifier("com.example.garbage", &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(STWErrorDatabase));

    std::map<std::string, STWCodeSigningEntry> delivered;
    STWErrorRef enumerationError = db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
        [&](const std::string& identifier, const std::shared_ptr<STWCodeSigningEntry>& entry) {
            delivered.emplace(identifier, *entry);
        });
    ASSERT_TRUE(enumerationError);
    EXPECT_TRUE(enumerationError->is(STWErrorDatabase));
    ASSERT_EQ(delivered.size(), 2u);
    EXPECT_EQ(delivered.at("com.example.good"), *good);
    EXPECT_EQ(delivered.at("com.example.other"), *other);
    // The identifiers themselves are intact.
    EXPECT_EQ(identifiers().size(), 4u);
}

TEST_F(STWSQLiteDBTest, EmptyDatabaseAnswersNothingWithoutError) {
    STWErrorRef error = STW_ERROR_NOLOG(STWErrorDatabase, nullptr, "left over from an earlier call");
    EXPECT_FALSE(db->identifiersWithError(&error));
    EXPECT_FALSE(error);
    int calls = 0;
    EXPECT_FALSE(db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
        [&](const std::string&, const std::shared_ptr<STWCodeSigningEntry>&) { ++calls; }));
    EXPECT_EQ(calls, 0);
    EXPECT_TRUE(db->deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(&error));
    EXPECT_FALSE(db->codeSigningEntryWithIdentifier("com.example.app", &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(STWErrorIdentifierNotInDatabase));
}

TEST_F(STWSQLiteDBTest, EnumerationBlockMayUseTheDatabaseOrThrow) {
    add(makeEntry("group.one"), "com.example.one");
    add(makeEntry("group.two"), "com.example.two");

    // Reads from inside the block, including a nested enumeration of the same query.
    int outer = 0, inner = 0;
    STWErrorRef error = db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
        [&](const std::string& identifier, const std::shared_ptr<STWCodeSigningEntry>& entry) {
            ++outer;
            auto again = db->codeSigningEntryWithIdentifier(identifier, nullptr);
            ASSERT_TRUE(again);
            EXPECT_EQ(*again, *entry);
            db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
                [&](const std::string&, const std::shared_ptr<STWCodeSigningEntry>&) { ++inner; });
        });
    EXPECT_FALSE(error);
    EXPECT_EQ(outer, 2);
    EXPECT_EQ(inner, 4);

    error = db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
        [](const std::string&, const std::shared_ptr<STWCodeSigningEntry>&) {
            throw std::runtime_error("stop");
        });
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(STWErrorException));
    add(makeEntry("group.three"), "com.example.three");
    outer = 0;
    EXPECT_FALSE(db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
        [&](const std::string&, const std::shared_ptr<STWCodeSigningEntry>&) { ++outer; }));
    EXPECT_EQ(outer, 3);
}

TEST_F(STWSQLiteDBTest, AcknowledgedWriteSurvivesAKilledDaemon) {
    std::filesystem::path shared = dir / "crash";
    std::filesystem::create_directory(shared);
    auto entry = makeEntry("group.durable", 4);
    entry->setChildBundleIdentifiers(std::vector<std::string>{"com.example.durable.widget"});
    EXPECT_EXIT(
        {
            auto writer = STWSQLiteDB::initWithParentDirectoryURL(shared);
            if (writer && writer->addCodeSigningEntry(entry, "com.example.durable", nullptr))
                raise(SIGKILL);
            _exit(1);
        },
        ::testing::KilledBySignal(SIGKILL), "");

    auto reopened = STWSQLiteDB::initWithParentDirectoryURL(shared);
    ASSERT_TRUE(reopened);
    STWErrorRef error;
    auto stored = reopened->codeSigningEntryWithIdentifier("com.example.durable", &error);
    ASSERT_TRUE(stored) << error->description();
    EXPECT_EQ(*stored, *entry);
}

TEST_F(STWSQLiteDBTest, SecondProcessOpeningTheFileIsStopped) {
    // The holder is a separate process that opened the file itself, so the refusal comes
    // from the file lock and not from anything this process shares with the holder.
    std::filesystem::path shared = dir / "held";
    std::filesystem::create_directory(shared);
    int ready[2], release[2];
    ASSERT_EQ(pipe(ready), 0);
    ASSERT_EQ(pipe(release), 0);
    pid_t holder = fork();
    ASSERT_NE(holder, -1);
    if (holder == 0) {
        close(ready[0]);
        close(release[1]);
        auto held = STWSQLiteDB::initWithParentDirectoryURL(shared);
        char byte = held ? 1 : 0;
        if (write(ready[1], &byte, 1) != 1)
            _exit(2);
        while (::read(release[0], &byte, 1) > 0) {
        }
        _exit(0);
    }
    close(ready[1]);
    close(release[0]);
    char byte = 0;
    ASSERT_EQ(::read(ready[0], &byte, 1), 1);
    ASSERT_EQ(byte, 1);

    EXPECT_DEATH(STWSQLiteDB::initWithParentDirectoryURL(shared), "Failed to initialize database, err = 5");

    close(release[1]);
    int status = 0;
    ASSERT_EQ(waitpid(holder, &status, 0), holder);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    close(ready[0]);
    // Once the holder is gone the file opens normally: it was the lock, not the file.
    EXPECT_TRUE(STWSQLiteDB::initWithParentDirectoryURL(shared));
}

TEST_F(STWSQLiteDBTest, UnusableFileStopsTheDaemon) {
    EXPECT_DEATH(STWSQLiteDB::initWithParentDirectoryURL(dir / "no" / "such" / "directory"),
                 "Failed to open database, err = 14");
    std::filesystem::path corrupt = dir / "corrupt";
    std::filesystem::create_directory(corrupt);
    std::ofstream(corrupt / "containers.sqlite3") << std::string(8192, 'x');
    EXPECT_DEATH(STWSQLiteDB::initWithParentDirectoryURL(corrupt), "Failed to initialize database, err = 26");
}

TEST_F(STWSQLiteDBTest, AnExceptionOnAnInternalBuildIsReportedWithItsStack) {
    STWTestRoot::shared();
    std::filesystem::path log = dir / "stowlyd.log";
    ASSERT_TRUE(STWLog::openLogFile(log, "com.vorlane.stowlyd", STWLogLevel::Error));
    STWLog::enableFileWriting(1, 1 << 20);
    add(makeEntry("group.one"), "com.example.one");
    auto thrower = [](const std::string&, const std::shared_ptr<STWCodeSigningEntry>&) {
        throw std::length_error("too long");
    };

    STWGlobalConfiguration::sharedInstance()->setIsInternalImage(false);
    STWErrorRef external = db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(thrower);
    STWLog::flush();
    std::string text;
    ASSERT_EQ(STWReadFileContents(log, &text), 0);
    EXPECT_EQ(text.find("** INTERNAL ERROR: Uncaught Exception **"), std::string::npos) << text;

    STWGlobalConfiguration::sharedInstance()->setIsInternalImage(true);
    STWErrorRef internal = db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(thrower);
    STWGlobalConfiguration::sharedInstance()->setIsInternalImage(false);
    STWLog::flush();
    STWLog::closeLogFile();
    ASSERT_EQ(STWReadFileContents(log, &text), 0);

    for (const STWErrorRef& error : {external, internal}) {
        ASSERT_TRUE(error);
        EXPECT_TRUE(error->is(STWErrorException));
        EXPECT_EQ(error->message(), "Got exception: std::length_error : too long");
    }
    size_t report = text.find("** INTERNAL ERROR: Uncaught Exception **");
    ASSERT_NE(report, std::string::npos) << text;
    EXPECT_NE(text.find("std::length_error: too long\nStack:\n", report), std::string::npos) << text;
    // The daemon goes on: the connection still serves.
    EXPECT_TRUE(read("com.example.one"));
}

} // namespace

#include "Daemon/CodeSigning/STWSQLiteDB.h"

#include "Daemon/Model/STWGlobalConfiguration.h"
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

using Strings = std::vector<std::string>;

std::shared_ptr<STWCodeSigningEntry> makeEntry(const std::string& group, uint64_t dataContainerClass = 2,
                                               std::optional<Strings> children = std::nullopt) {
    STWValue::Dictionary entitlements{
        {"com.vorlane.security.application-groups", STWValue(STWValue::Array{STWValue(group)})}};
    STWValue::Dictionary info{{"com.vorlane.Stowly.Entitlements", STWValue(std::move(entitlements))}};
    auto entry = std::make_shared<STWCodeSigningEntry>(std::move(info), dataContainerClass);
    if (children)
        entry->setChildBundleIdentifiers(*children);
    return entry;
}

bool is(const STWErrorRef& error, uint64_t code) {
    return error && error->is(code);
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
    // Whether the stored entry equals `expected`.
    bool stored(const std::string& identifier, const STWCodeSigningEntry& expected) {
        auto entry = read(identifier);
        return entry && *entry == expected;
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
    int64_t rows(const char* table) { return queryInt(std::string("SELECT count(*) FROM ") + table + ";"); }
    void replaceData(const std::string& identifier, const std::string& bytes) {
        std::string sql = "UPDATE code_signing_data SET data = X'";
        for (unsigned char byte : bytes)
            sql += {"0123456789abcdef"[byte >> 4], "0123456789abcdef"[byte & 15]};
        sql += "' WHERE cs_info_id = (SELECT id FROM code_signing_info WHERE code_signing_id_text = '" +
               identifier + "');";
        EXPECT_EQ(sqlite3_exec(db->db(), sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK) << sql;
        EXPECT_EQ(sqlite3_changes(db->db()), 1);
    }
    Strings identifiers() {
        STWErrorRef error;
        auto ids = db->identifiersWithError(&error);
        EXPECT_FALSE(error);
        Strings sorted = ids.value_or(Strings());
        std::sort(sorted.begin(), sorted.end());
        return sorted;
    }

    std::filesystem::path dir;
    std::unique_ptr<STWSQLiteDB> db;
};

TEST_F(STWSQLiteDBTest, RewriteUpdatesTheSameRowOfAFullySyncedWriteAheadLog) {
    // What makes an acknowledged write survive a power cut, not only a killed process.
    EXPECT_EQ(queryInt("SELECT journal_mode = 'wal' FROM pragma_journal_mode;"), 1);
    EXPECT_EQ(queryInt("PRAGMA synchronous;"), 2); // FULL
    EXPECT_EQ(queryInt("PRAGMA foreign_keys;"), 1);

    auto first = makeEntry("group.first", 7);
    first->setInvalid(true);
    first->setRegisteredByCaller(true);
    add(first, "com.example.app");
    EXPECT_TRUE(stored("com.example.app", *first));
    const char* rowID = "SELECT id FROM code_signing_info WHERE code_signing_id_text = 'com.example.app';";
    int64_t row = queryInt(rowID);

    auto second = makeEntry("group.second", 3);
    second->setPlaceholder(true);
    add(second, "com.example.app");
    EXPECT_TRUE(stored("com.example.app", *second));
    EXPECT_EQ(queryInt(rowID), row);
    EXPECT_EQ(rows("code_signing_info"), 1);
    EXPECT_EQ(rows("code_signing_data"), 1);
}

TEST_F(STWSQLiteDBTest, FailedWritesMissingIdentifiersAndAnEmptyDatabase) {
    STWErrorRef error = STW_ERROR_NOLOG(STWErrorDatabase, nullptr, "left over from an earlier call");
    EXPECT_FALSE(db->identifiersWithError(&error));
    EXPECT_FALSE(error) << "an empty database is no error";
    int calls = 0;
    EXPECT_FALSE(db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
        [&](const std::string&, const std::shared_ptr<STWCodeSigningEntry>&) { ++calls; }));
    EXPECT_EQ(calls, 0);
    EXPECT_TRUE(db->invalidateCodeSigningWithIdentifier("com.example.missing", &error));
    EXPECT_TRUE(db->invalidateCodeSigningForIdentifierAndAllChildren("com.example.missing", &error));
    EXPECT_FALSE(error);
    EXPECT_TRUE(identifiers().empty()) << "invalidating nothing stores nothing";
    EXPECT_FALSE(db->deleteCodeSigningEntryWithIdentifier("com.example.missing", &error));
    EXPECT_TRUE(is(error, STWErrorDatabase));
    EXPECT_TRUE(is(error ? error->underlyingError() : nullptr, STWErrorUnexpectedRowCount));

    // An entry without an info dictionary cannot be stored: the info row written before
    // the failure must go with the rolled-back transaction.
    error = nullptr;
    EXPECT_FALSE(db->addCodeSigningEntry(std::make_shared<STWCodeSigningEntry>(), "com.example.new", &error));
    EXPECT_TRUE(is(error, STWErrorDatabase));
    EXPECT_TRUE(identifiers().empty());
    auto original = makeEntry("group.kept");
    add(original, "com.example.app");
    auto broken = std::make_shared<STWCodeSigningEntry>();
    broken->setInvalid(true);
    EXPECT_FALSE(db->addCodeSigningEntry(broken, "com.example.app", nullptr));
    EXPECT_TRUE(stored("com.example.app", *original));
    error = nullptr;
    EXPECT_FALSE(db->addCodeSigningEntry(nullptr, "com.example.app", &error));
    EXPECT_TRUE(is(error, STWErrorInvalidArgument));
    add(makeEntry("group.after"), "com.example.after");
    EXPECT_EQ(identifiers(), (Strings{"com.example.after", "com.example.app"}));

    ASSERT_TRUE(db->invalidateCodeSigningWithIdentifier("com.example.app", &error));
    EXPECT_TRUE(read("com.example.app")->invalid());
    EXPECT_TRUE(db->deleteCodeSigningEntryWithIdentifier("com.example.app", &error));
    error = nullptr;
    EXPECT_FALSE(db->codeSigningEntryWithIdentifier("com.example.app", &error));
    EXPECT_TRUE(is(error, STWErrorIdentifierNotInDatabase));
}

TEST_F(STWSQLiteDBTest, AdvanceCopyPurgeKeepsPlainPlaceholders) {
    auto both = makeEntry("group.both", 2, Strings{"com.example.both.widget"});
    both->setPlaceholder(true);
    both->setAdvanceCopy(true);
    auto advanceOnly = makeEntry("group.advance");
    advanceOnly->setAdvanceCopy(true);
    auto placeholderOnly = makeEntry("group.placeholder");
    placeholderOnly->setPlaceholder(true);
    add(both, "com.example.both");
    add(advanceOnly, "com.example.advance");
    add(placeholderOnly, "com.example.placeholder");
    add(makeEntry("group.plain"), "com.example.plain");
    // Both flags share one column of the file.
    EXPECT_EQ(queryInt("SELECT placeholder FROM code_signing_info WHERE code_signing_id_text = 'com.example.both';"),
              3);
    EXPECT_TRUE(stored("com.example.both", *both));

    STWErrorRef error;
    ASSERT_TRUE(db->deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(&error)) << error->description();
    EXPECT_EQ(identifiers(), (Strings{"com.example.placeholder", "com.example.plain"}));
    EXPECT_TRUE(stored("com.example.placeholder", *placeholderOnly));
    EXPECT_EQ(rows("code_signing_data"), 2);
    EXPECT_FALSE(db->parentIdentifierForChildIdentifier("com.example.both.widget", nullptr));
}

TEST_F(STWSQLiteDBTest, ChildrenKeepTheirOrderMoveBetweenParentsAndGoWithTheirParent) {
    // Not in alphabetical order, so that an ordering by text would show.
    Strings children{"com.example.a.widget", "com.example.a.share", "com.example.a.intents"};
    auto parentA = makeEntry("group.a", 2, children);
    add(parentA, "com.example.a");
    add(makeEntry("group.a"), "com.example.a.share");
    add(makeEntry("group.a"), "com.example.a.intents");

    STWErrorRef error;
    EXPECT_EQ(db->childIdentifiersForParentIdentifier("com.example.a", &error), children);
    EXPECT_TRUE(stored("com.example.a", *parentA));
    EXPECT_FALSE(read("com.example.a.share")->childBundleIdentifiers());

    add(makeEntry("group.b", 2, Strings{"com.example.a.share"}), "com.example.b");
    EXPECT_EQ(db->parentIdentifierForChildIdentifier("com.example.a.share", &error), "com.example.b");
    EXPECT_EQ(db->childIdentifiersForParentIdentifier("com.example.a", &error),
              (Strings{"com.example.a.widget", "com.example.a.intents"}));

    // The family is A and its remaining children; the moved child belongs to B now.
    ASSERT_TRUE(db->invalidateCodeSigningForIdentifierAndAllChildren("com.example.a", &error));
    EXPECT_TRUE(read("com.example.a")->invalid());
    EXPECT_TRUE(read("com.example.a.intents")->invalid());
    EXPECT_FALSE(read("com.example.a.share")->invalid());

    ASSERT_TRUE(db->deleteCodeSigningEntryWithIdentifier("com.example.a", &error));
    error = nullptr;
    EXPECT_FALSE(db->parentIdentifierForChildIdentifier("com.example.a.intents", &error));
    EXPECT_TRUE(is(error, STWErrorIdentifierNotInDatabase));
    EXPECT_FALSE(db->childIdentifiersForParentIdentifier("com.example.a", nullptr));
    EXPECT_EQ(identifiers(), (Strings{"com.example.a.intents", "com.example.a.share", "com.example.b"}));
    EXPECT_EQ(rows("code_signing_data"), 3);
    EXPECT_EQ(rows("child_bundles"), 1);
}

TEST_F(STWSQLiteDBTest, UnreadableDataIsReportedAndSkippedByEnumeration) {
    auto good = makeEntry("group.good", 2, Strings{"com.example.good.widget"});
    auto other = makeEntry("group.other", 5);
    add(good, "com.example.good");
    add(makeEntry("group.array"), "com.example.array");
    add(makeEntry("group.garbage"), "com.example.garbage");
    add(other, "com.example.other");
    replaceData("com.example.array", STWPropertyList::serializeBinary(
                                         STWValue(STWValue::Array{STWValue("not"), STWValue("a dict")})));
    replaceData("com.example.garbage", std::string("\x00\x01\x02\x03garbage", 11));

    STWErrorRef error;
    EXPECT_FALSE(db->codeSigningEntryWithIdentifier("com.example.array", &error));
    ASSERT_TRUE(is(error, STWErrorDatabase));
    ASSERT_TRUE(error->underlyingError());
    EXPECT_EQ(error->underlyingError()->domain(), STWGenericErrorDomain);
    EXPECT_EQ(error->underlyingError()->code(), STWGenericErrorCorruptFile);
    error = nullptr;
    EXPECT_FALSE(db->codeSigningEntryWithIdentifier("com.example.garbage", &error));
    EXPECT_TRUE(is(error, STWErrorDatabase));

    std::map<std::string, STWCodeSigningEntry> delivered;
    error = db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
        [&](const std::string& identifier, const std::shared_ptr<STWCodeSigningEntry>& entry) {
            delivered.emplace(identifier, *entry);
        });
    EXPECT_TRUE(is(error, STWErrorDatabase));
    EXPECT_EQ(delivered, (std::map<std::string, STWCodeSigningEntry>{{"com.example.good", *good},
                                                                      {"com.example.other", *other}}));
    EXPECT_EQ(identifiers().size(), 4u) << "the identifiers themselves are intact";
}

TEST_F(STWSQLiteDBTest, AcknowledgedWriteSurvivesAKilledDaemon) {
    std::filesystem::path shared = dir / "crash";
    std::filesystem::create_directory(shared);
    auto entry = makeEntry("group.durable", 4, Strings{"com.example.durable.widget"});
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

TEST_F(STWSQLiteDBTest, AFileThatCannotBeOpenedOrIsHeldStopsTheDaemon) {
    EXPECT_DEATH(STWSQLiteDB::initWithParentDirectoryURL(dir / "no" / "such" / "directory"),
                 "Failed to open database, err = 14");
    std::filesystem::path corrupt = dir / "corrupt";
    std::filesystem::create_directory(corrupt);
    std::ofstream(corrupt / "containers.sqlite3") << std::string(8192, 'x');
    EXPECT_DEATH(STWSQLiteDB::initWithParentDirectoryURL(corrupt), "Failed to initialize database, err = 26");

    // The holder is a separate process that opened the file itself, so the refusal comes
    // from the file lock and not from anything this process shares with the holder.
    std::filesystem::path shared = dir / "held";
    std::filesystem::create_directory(shared);
    int ready[2];
    ASSERT_EQ(pipe(ready), 0);
    pid_t holder = fork();
    ASSERT_NE(holder, -1);
    if (holder == 0) {
        auto held = STWSQLiteDB::initWithParentDirectoryURL(shared);
        char opened = held ? 1 : 0;
        if (write(ready[1], &opened, 1) == 1 && opened)
            pause();
        _exit(1);
    }
    close(ready[1]);
    char opened = 0;
    EXPECT_EQ(::read(ready[0], &opened, 1), 1);
    close(ready[0]);
    EXPECT_EQ(opened, 1);
    EXPECT_DEATH(STWSQLiteDB::initWithParentDirectoryURL(shared), "Failed to initialize database, err = 5");
    kill(holder, SIGKILL);
    ASSERT_EQ(waitpid(holder, nullptr, 0), holder);
    // Once the holder is gone the file opens normally: it was the lock, not the file.
    EXPECT_TRUE(STWSQLiteDB::initWithParentDirectoryURL(shared));
}

// A throw from the block is code 40, on an internal image too; the block may use the
// database, a nested enumeration of the same query included.
TEST_F(STWSQLiteDBTest, EnumerationBlockMayThrowOrUseTheDatabase) {
    STWTestRoot::shared();
    add(makeEntry("group.one"), "com.example.one");
    add(makeEntry("group.two"), "com.example.two");
    STWGlobalConfiguration::sharedInstance()->setIsInternalImage(true);
    STWErrorRef thrown = db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
        [](const std::string&, const std::shared_ptr<STWCodeSigningEntry>&) {
            throw std::length_error("too long");
        });
    STWGlobalConfiguration::sharedInstance()->setIsInternalImage(false);
    ASSERT_TRUE(is(thrown, STWErrorException));
    EXPECT_EQ(thrown->message(), "Got exception: std::length_error : too long");

    int outer = 0, inner = 0;
    STWErrorRef error = db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
        [&](const std::string& identifier, const std::shared_ptr<STWCodeSigningEntry>& entry) {
            ++outer;
            EXPECT_TRUE(stored(identifier, *entry));
            db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
                [&](const std::string&, const std::shared_ptr<STWCodeSigningEntry>&) { ++inner; });
        });
    EXPECT_FALSE(error);
    EXPECT_EQ(outer, 2);
    EXPECT_EQ(inner, 4);
}

} // namespace

// Cost of STWSQLiteDB over the bare SQLite calls it makes.
//
// Writes and then reads the same entries through STWSQLiteDB and through a direct
// implementation of the same statements (same transaction per entry, same row-count
// check, same property-list encoding, prepared statements reused) on a connection set up
// by the same open path, in files side by side on the same file system. Rounds alternate
// which side goes first so that neither always meets a warm or a cold disk.
//
// Usage: stowly_bench_codesigning [--quick]

#include "Daemon/CodeSigning/STWSQLiteDB.h"
#include "bench/support/STWBenchSupport.h"
#include "common/STWPropertyList.h"

#include <sqlite3.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

namespace {

using STWBench::timed;

struct Workload {
    std::vector<std::string> identifiers;
    std::vector<std::shared_ptr<STWCodeSigningEntry>> entries;
};

Workload makeWorkload(size_t count) {
    Workload workload;
    for (size_t i = 0; i < count; ++i) {
        std::string identifier = "com.example.bench.app" + std::to_string(i);
        STWValue::Dictionary entitlements{
            {"com.vorlane.security.application-groups",
             STWValue(STWValue::Array{STWValue("group.com.example.bench" + std::to_string(i % 97))})},
            {"com.vorlane.security.system-container", STWValue(i % 11 == 0)},
            {"keychain-access-groups", STWValue(STWValue::Array{STWValue("TEAM." + identifier)})},
        };
        STWValue::Dictionary info{{"com.vorlane.Stowly.Entitlements", STWValue(std::move(entitlements))},
                                  {"SignerIdentity", STWValue("Bench Signer")}};
        auto entry = std::make_shared<STWCodeSigningEntry>(std::move(info), 2);
        entry->setPlaceholder(i % 7 == 0);
        if (i % 5 == 0)
            entry->setChildBundleIdentifiers(std::vector<std::string>{identifier + ".widget"});
        workload.identifiers.push_back(std::move(identifier));
        workload.entries.push_back(std::move(entry));
    }
    return workload;
}

[[noreturn]] void die(const char* what, sqlite3* db) {
    fprintf(stderr, "baseline: %s failed: %s\n", what, db ? sqlite3_errmsg(db) : "");
    exit(1);
}

// The same statements as STWSQLiteDB issues, written straight against SQLite.
class Baseline {
public:
    explicit Baseline(sqlite3* db) : _db(db) {
        prepare(&_update, "UPDATE code_signing_info SET invalid=?, placeholder=?, registered_by_caller=?, "
                          "data_container_class=? WHERE code_signing_id_text=?;");
        prepare(&_insert, "INSERT INTO code_signing_info (invalid, placeholder, registered_by_caller, "
                          "data_container_class, code_signing_id_text) VALUES (?, ?, ?, ?, ?);");
        prepare(&_data, "INSERT OR REPLACE INTO code_signing_data (cs_info_id, data) SELECT id, ? FROM "
                        "code_signing_info WHERE code_signing_id_text = ?;");
        prepare(&_child,
                "INSERT OR REPLACE INTO child_bundles (parent_id, child_code_signing_id_text) SELECT id, ? "
                "FROM code_signing_info WHERE code_signing_id_text = ?;");
        prepare(&_select,
                "SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
                "code_signing_info.registered_by_caller, code_signing_info.data_container_class FROM "
                "code_signing_info, code_signing_data WHERE code_signing_info.id = "
                "code_signing_data.cs_info_id AND code_signing_info.code_signing_id_text = ?;");
        prepare(&_children,
                "SELECT child_bundles.child_code_signing_id_text FROM child_bundles, code_signing_info "
                "WHERE code_signing_info.code_signing_id_text = ? AND "
                "child_bundles.parent_id=code_signing_info.id;");
    }
    ~Baseline() {
        for (sqlite3_stmt* s : {_update, _insert, _data, _child, _select, _children})
            sqlite3_finalize(s);
        sqlite3_close(_db);
    }

    void write(const STWCodeSigningEntry& entry, const std::string& identifier) {
        exec("BEGIN;");
        bindInfo(_update, entry, identifier);
        if (sqlite3_step(_update) != SQLITE_DONE)
            die("update", _db);
        bool updated = sqlite3_changes(_db) == 1;
        sqlite3_reset(_update);
        if (!updated) {
            bindInfo(_insert, entry, identifier);
            if (sqlite3_step(_insert) != SQLITE_DONE)
                die("insert", _db);
            sqlite3_reset(_insert);
        }
        std::string bytes = STWPropertyList::serializeBinary(STWValue(*entry.codeSigningInfo()));
        sqlite3_bind_blob64(_data, 1, bytes.data(), bytes.size(), SQLITE_TRANSIENT);
        sqlite3_bind_text(_data, 2, identifier.c_str(), -1, SQLITE_TRANSIENT);
        if (sqlite3_step(_data) != SQLITE_DONE)
            die("data insert", _db);
        sqlite3_reset(_data);
        if (const auto& children = entry.childBundleIdentifiers()) {
            for (const std::string& child : *children) {
                sqlite3_bind_text(_child, 1, child.c_str(), -1, SQLITE_TRANSIENT);
                sqlite3_bind_text(_child, 2, identifier.c_str(), -1, SQLITE_TRANSIENT);
                sqlite3_step(_child);
                sqlite3_reset(_child);
            }
        }
        exec("COMMIT;");
    }

    std::shared_ptr<STWCodeSigningEntry> read(const std::string& identifier) {
        sqlite3_bind_text(_select, 1, identifier.c_str(), -1, SQLITE_TRANSIENT);
        std::shared_ptr<STWCodeSigningEntry> entry;
        if (sqlite3_step(_select) == SQLITE_ROW) {
            const void* blob = sqlite3_column_blob(_select, 0);
            int length = sqlite3_column_bytes(_select, 0);
            auto info = STWPropertyList::parse(std::string_view(static_cast<const char*>(blob), length));
            if (info && info->dictionary()) {
                entry = std::make_shared<STWCodeSigningEntry>(std::move(*info->mutableDictionary()));
                int flags = sqlite3_column_int(_select, 2);
                entry->setInvalid(sqlite3_column_int(_select, 1) != 0);
                entry->setPlaceholder(flags & 1);
                entry->setAdvanceCopy(flags & 2);
                entry->setRegisteredByCaller(sqlite3_column_int(_select, 3) != 0);
                entry->setDataContainerClass(static_cast<uint32_t>(sqlite3_column_int(_select, 4)));
            }
        }
        sqlite3_reset(_select);
        if (!entry)
            return nullptr;
        sqlite3_bind_text(_children, 1, identifier.c_str(), -1, SQLITE_TRANSIENT);
        std::vector<std::string> children;
        while (sqlite3_step(_children) == SQLITE_ROW)
            if (const unsigned char* text = sqlite3_column_text(_children, 0))
                children.emplace_back(reinterpret_cast<const char*>(text));
        sqlite3_reset(_children);
        if (!children.empty())
            entry->setChildBundleIdentifiers(std::move(children));
        return entry;
    }

private:
    void prepare(sqlite3_stmt** statement, const char* sql) {
        if (sqlite3_prepare_v2(_db, sql, -1, statement, nullptr) != SQLITE_OK)
            die(sql, _db);
    }
    void exec(const char* sql) {
        if (sqlite3_exec(_db, sql, nullptr, nullptr, nullptr) != SQLITE_OK)
            die(sql, _db);
    }
    void bindInfo(sqlite3_stmt* statement, const STWCodeSigningEntry& entry, const std::string& identifier) {
        sqlite3_bind_int(statement, 1, entry.invalid() ? 1 : 0);
        sqlite3_bind_int(statement, 2, (entry.placeholder() ? 1 : 0) | (entry.advanceCopy() ? 2 : 0));
        sqlite3_bind_int(statement, 3, entry.registeredByCaller() ? 1 : 0);
        sqlite3_bind_int(statement, 4, static_cast<int>(static_cast<uint32_t>(entry.dataContainerClass())));
        sqlite3_bind_text(statement, 5, identifier.c_str(), -1, SQLITE_TRANSIENT);
    }

    sqlite3* _db;
    sqlite3_stmt* _update = nullptr;
    sqlite3_stmt* _insert = nullptr;
    sqlite3_stmt* _data = nullptr;
    sqlite3_stmt* _child = nullptr;
    sqlite3_stmt* _select = nullptr;
    sqlite3_stmt* _children = nullptr;
};

// Both sides run the same slice of the workload back to back, taking turns at going first,
// so that both meet the same disk and the same neighbours; the figure is the median of the
// per-slice ratios, which a stray stall on one slice does not move.
struct Figures {
    std::vector<double> ratios;
    double ours = 0, direct = 0;

    void add(double oursSeconds, double directSeconds) {
        ratios.push_back(oursSeconds / directSeconds);
        ours += oursSeconds;
        direct += directSeconds;
    }
    double median() const { return STWBench::median(ratios, STWBench::EvenMiddle::mean); }
};

} // namespace

int main(int argc, char** argv) {
    bool quick = argc > 1 && strcmp(argv[1], "--quick") == 0;
    // Every write is a synced commit (about 4 ms each on a busy development disk, for
    // both sides), so writes dominate the run time: the quick run stays near 20 s.
    const size_t count = quick ? 2500 : 10000;
    const int rounds = quick ? 1 : 2;
    const size_t slice = 250;
    const int readPasses = quick ? 2 : 4;

    char templ[] = "/tmp/stowly-bench-csdb-XXXXXX";
    if (!mkdtemp(templ)) {
        perror("mkdtemp");
        return 1;
    }
    std::filesystem::path root = templ;
    Workload workload = makeWorkload(count);
    Figures writes, reads;
    size_t checked = 0;

    for (int round = 0; round < rounds; ++round) {
        std::filesystem::path ours = root / ("stowly" + std::to_string(round));
        std::filesystem::path theirs = root / ("direct" + std::to_string(round));
        std::filesystem::create_directories(ours);
        std::filesystem::create_directories(theirs);
        auto db = STWSQLiteDB::initWithParentDirectoryURL(ours);
        Baseline baseline(STWSQLiteDB::openDBWithURL(theirs / "containers.sqlite3"));

        for (size_t first = 0, turn = 0; first < count; first += slice, ++turn) {
            size_t last = std::min(first + slice, count);
            auto writeOurs = [&] {
                return timed([&] {
                    for (size_t i = first; i < last; ++i)
                        if (!db->addCodeSigningEntry(workload.entries[i], workload.identifiers[i], nullptr))
                            exit(1);
                });
            };
            auto writeDirect = [&] {
                return timed([&] {
                    for (size_t i = first; i < last; ++i)
                        baseline.write(*workload.entries[i], workload.identifiers[i]);
                });
            };
            if (turn % 2 == 0) {
                double a = writeOurs();
                writes.add(a, writeDirect());
            } else {
                double b = writeDirect();
                writes.add(writeOurs(), b);
            }
        }
        for (int pass = 0; pass < readPasses; ++pass) {
            for (size_t first = 0, turn = pass; first < count; first += slice, ++turn) {
                size_t last = std::min(first + slice, count);
                auto readOurs = [&] {
                    return timed([&] {
                        for (size_t i = first; i < last; ++i)
                            if (!db->codeSigningEntryWithIdentifier(workload.identifiers[i], nullptr))
                                exit(1);
                    });
                };
                auto readDirect = [&] {
                    return timed([&] {
                        for (size_t i = first; i < last; ++i)
                            if (!baseline.read(workload.identifiers[i]))
                                exit(1);
                    });
                };
                if (turn % 2 == 0) {
                    double a = readOurs();
                    reads.add(a, readDirect());
                } else {
                    double b = readDirect();
                    reads.add(readOurs(), b);
                }
            }
        }
        // Both sides must have stored the same thing, or the comparison means nothing.
        for (size_t i = 0; i < count; i += 97, ++checked) {
            auto a = db->codeSigningEntryWithIdentifier(workload.identifiers[i], nullptr);
            auto b = baseline.read(workload.identifiers[i]);
            if (!a || !b || !(*a == *b) || !(*a == *workload.entries[i])) {
                fprintf(stderr, "entry %zu differs between the two stores\n", i);
                return 1;
            }
        }
    }
    std::filesystem::remove_all(root);

    double written = static_cast<double>(count) * rounds;
    double read = written * readPasses;
    printf("codesigning_db_write: ratio %.2f (goal <= 1.2)\n", writes.median());
    printf("codesigning_db_read: ratio %.2f (goal <= 1.2)\n", reads.median());
    printf("  %zu entries x %d rounds in slices of %zu, %zu spot-checked equal in both stores\n", count,
           rounds, slice, checked);
    printf("  write: STWSQLiteDB %.1f us/entry, direct sqlite3 %.1f us/entry (ratio of totals %.2f)\n",
           writes.ours / written * 1e6, writes.direct / written * 1e6, writes.ours / writes.direct);
    printf("  read:  STWSQLiteDB %.2f us/entry, direct sqlite3 %.2f us/entry (ratio of totals %.2f)\n",
           reads.ours / read * 1e6, reads.direct / read * 1e6, reads.ours / reads.direct);
    return 0;
}

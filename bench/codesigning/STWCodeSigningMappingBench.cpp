// The code-signing mapping and group containers, each figure against a baseline measured in
// the same run:
//
//   codesigning_process_apps  processing the code-signing info of new apps with three app
//       groups each through the mapping, against writing the same rows (info row, data row)
//       with direct sqlite3 statements, one transaction per app, on a database opened the
//       same way in the same directory. Rounds alternate which side goes first.
//   group_sweep  a full sweep of the application-group class over 10,000 stored entries and
//       2,000 group containers (the class cache warm, as after the first look-up), against a
//       bare listing of the group class directory plus one read of every stored entry (row,
//       blob parsed to its dictionary) with direct sqlite3 statements.
//   group_lookup  command 13 for an app with three existing groups, against three command-0
//       look-ups of the same containers, over the socket of a real stowlyd.
//
// Usage: stowly_bench_codesigning_mapping [--quick]
#include "Daemon/CodeSigning/STWCodeSigningMapping.h"
#include "Daemon/CodeSigning/STWGroupManager.h"
#include "Daemon/Lifecycle/STWCommandQueue.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWMetadata.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "bench/support/STWBenchSupport.h"
#include "common/STWPropertyList.h"
#include "platform/STWPlatformConfiguration.h"
#include "platform/STWQueue.h"
#include "tests/support/STWDaemonProcess.h"

#include <sqlite3.h>

#include <cstdio>
#include <cstring>
#include <dirent.h>
#include <stdexcept>

namespace {

using STWBench::timed;

[[noreturn]] void die(const std::string& message) { throw std::runtime_error(message); }

double median(const std::vector<double>& values) { return STWBench::median(values, STWBench::EvenMiddle::mean); }

STWValue::Dictionary appInfo(const std::string& identifier, size_t groupBase) {
    STWValue::Array groups;
    for (size_t g = 0; g < 3; ++g)
        groups.emplace_back("group.bench." + std::to_string(groupBase + g));
    STWValue::Dictionary entitlements{{STWEntitlementKey::applicationGroups, STWValue(std::move(groups))},
                                      {"keychain-access-groups", STWValue(STWValue::Array{STWValue("TEAM." + identifier)})}};
    return {{STWEntitlementKey::entitlements, STWValue(std::move(entitlements))},
            {"SignerIdentity", STWValue("Bench Signer")}};
}

void exec(sqlite3* db, const char* sql) {
    char* message = nullptr;
    if (sqlite3_exec(db, sql, nullptr, nullptr, &message) != SQLITE_OK) {
        std::string text = message ? message : "";
        sqlite3_free(message);
        die(std::string(sql) + ": " + text);
    }
}

// The rows the mapping writes for a new app, written straight against SQLite.
class DirectWriter {
public:
    explicit DirectWriter(const std::filesystem::path& url) : _db(STWSQLiteDB::openDBWithURL(url)) {
        sqlite3_prepare_v2(_db, "INSERT INTO code_signing_info (invalid, placeholder, registered_by_caller, "
                                "data_container_class, code_signing_id_text) VALUES (0, 0, 0, ?, ?);",
                           -1, &_info, nullptr);
        sqlite3_prepare_v2(_db, "INSERT OR REPLACE INTO code_signing_data (cs_info_id, data) SELECT id, ? FROM "
                                "code_signing_info WHERE code_signing_id_text = ?;",
                           -1, &_data, nullptr);
    }
    ~DirectWriter() {
        sqlite3_finalize(_info);
        sqlite3_finalize(_data);
        sqlite3_close(_db);
    }
    void write(const std::string& identifier, const STWValue::Dictionary& info) {
        exec(_db, "BEGIN;");
        sqlite3_bind_int(_info, 1, 2);
        sqlite3_bind_text(_info, 2, identifier.c_str(), -1, SQLITE_TRANSIENT);
        if (sqlite3_step(_info) != SQLITE_DONE)
            die("insert");
        sqlite3_reset(_info);
        std::string bytes = STWPropertyList::serializeBinary(STWValue(info));
        sqlite3_bind_blob64(_data, 1, bytes.data(), bytes.size(), SQLITE_TRANSIENT);
        sqlite3_bind_text(_data, 2, identifier.c_str(), -1, SQLITE_TRANSIENT);
        if (sqlite3_step(_data) != SQLITE_DONE)
            die("data insert");
        sqlite3_reset(_data);
        exec(_db, "COMMIT;");
    }
    sqlite3* db() const { return _db; }

private:
    sqlite3* _db;
    sqlite3_stmt* _info = nullptr;
    sqlite3_stmt* _data = nullptr;
};

void processApps(STWCodeSigningMapping& mapping, bool quick) {
    size_t apps = quick ? 200 : 1000;
    int rounds = quick ? 1 : 3;
    DirectWriter direct(STWGlobalConfiguration::sharedInstance()->libraryDirectory() / "direct.sqlite3");
    STWValue::Dictionary options{{"com.vorlane.Stowly.DataContainerClass", STWValue(2)}};
    std::vector<double> ratios;
    double ours = 0, theirs = 0;
    for (int round = 0; round < rounds; ++round) {
        auto queue = STWCommandQueue::init();
        auto viaMapping = [&] {
            for (size_t i = 0; i < apps; ++i) {
                std::string identifier = "com.bench.app" + std::to_string(round) + "." + std::to_string(i);
                if (mapping.processCodeSigningInfo(appInfo(identifier, i), identifier, options, *queue) != 1)
                    die("processing " + identifier);
            }
        };
        auto viaSQLite = [&] {
            for (size_t i = 0; i < apps; ++i) {
                std::string identifier = "com.bench.app" + std::to_string(round) + "." + std::to_string(i);
                direct.write(identifier, appInfo(identifier, i));
            }
        };
        double a, b;
        if (round % 2) {
            b = timed(viaSQLite);
            a = timed(viaMapping);
        } else {
            a = timed(viaMapping);
            b = timed(viaSQLite);
        }
        ratios.push_back(a / b);
        ours += a;
        theirs += b;
    }
    printf("codesigning_process_apps: ratio %.2f (goal <= 1.5)\n", median(ratios));
    printf("  %zu apps x %d rounds: mapping %.0f us/app, direct sqlite3 %.0f us/app\n", apps, rounds,
           ours / (apps * rounds) * 1e6, theirs / (apps * rounds) * 1e6);
}

void groupSweep(STWCodeSigningMapping& mapping, bool quick) {
    size_t entries = quick ? 2000 : 10000, containers = quick ? 400 : 2000;
    auto configuration = STWGlobalConfiguration::sharedInstance();
    // Filling: one transaction for all entries, which the mapping would never do, so that
    // the set-up does not take a synced commit per entry.
    mapping.queue()->sync([&] {
        sqlite3* db = mapping.codeSigningMappingDB().db();
        exec(db, "PRAGMA synchronous = OFF;");
        for (size_t i = 0; i < entries; ++i) {
            std::string identifier = "com.bench.sweep" + std::to_string(i);
            auto entry = std::make_shared<STWCodeSigningEntry>(appInfo(identifier, (i * 3) % containers), 2);
            if (!mapping.codeSigningMappingDB().addCodeSigningEntry(entry, identifier, nullptr))
                die("filling the database");
        }
        exec(db, "PRAGMA synchronous = FULL;");
    });
    auto user = STWUserIdentitySharedCache::sharedInstance()->userIdentityForPersonalPersona();
    std::filesystem::path classDirectory =
        *configuration->containerDirectoryURLForUserIdentity(user, STWContainerClassSharedAppGroup, false);
    // A tenth of the containers are named by no entry.
    for (size_t i = 0; i < containers; ++i) {
        std::string group = i < containers / 10 ? "group.bench.unreferenced." + std::to_string(i)
                                                : "group.bench." + std::to_string(i);
        STWUUID uuid = STWUUID::random();
        auto identity = STWConcreteContainerIdentity::containerIdentityWithUUID(uuid, user, group,
                                                                                STWContainerClassSharedAppGroup, nullptr);
        std::filesystem::path url = classDirectory / uuid.string();
        std::filesystem::create_directories(url);
        STWMetadata metadata(identity, std::nullopt, url, std::nullopt);
        if (!metadata.writeMetadataToDiskWithError(nullptr))
            die("writing a group container");
    }
    auto sweep = [&] {
        auto queue = STWCommandQueue::init();
        STWGroupManager::defaultManager()->reconcileGroupContainersOfType(STWGroupTypeApplication, *queue);
        if (queue->count() != containers / 10)
            die("the sweep queued " + std::to_string(queue->count()) + " deletions");
    };
    // The baseline reads the mapping's own file, on the mapping's queue, through a second
    // statement on its connection (the file is held exclusively).
    auto baseline = [&] {
        size_t names = 0;
        if (DIR* dir = opendir(classDirectory.c_str())) {
            while (readdir(dir))
                ++names;
            closedir(dir);
        }
        mapping.queue()->sync([&] {
            sqlite3_stmt* select = nullptr;
            sqlite3_prepare_v2(mapping.codeSigningMappingDB().db(),
                               "SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
                               "code_signing_info.registered_by_caller, code_signing_info.data_container_class, "
                               "code_signing_info.code_signing_id_text FROM code_signing_info, code_signing_data WHERE "
                               "code_signing_info.id = code_signing_data.cs_info_id;",
                               -1, &select, nullptr);
            size_t rows = 0;
            while (sqlite3_step(select) == SQLITE_ROW) {
                auto info = STWPropertyList::parse(std::string_view(
                    static_cast<const char*>(sqlite3_column_blob(select, 0)), sqlite3_column_bytes(select, 0)));
                rows += info && info->dictionary();
            }
            sqlite3_finalize(select);
            if (rows < entries)
                die("the baseline read " + std::to_string(rows) + " entries");
        });
        if (names < containers)
            die("the baseline listed too few containers");
    };
    sweep(); // builds the class cache
    std::vector<double> ratios;
    for (int round = 0; round < (quick ? 3 : 7); ++round) {
        double a = timed(sweep), b = timed(baseline);
        ratios.push_back(a / b);
    }
    printf("group_sweep: ratio %.2f (goal <= 2)\n", median(ratios));
    printf("  %zu stored entries, %zu group containers\n", entries, containers);
}

void groupLookup(bool quick) {
    STWDaemonProcess daemon({{"DeveloperMode", STWValue(true)}});
    const STWValue::Dictionary allowed{{"com.vorlane.private.Stowly.allowed", STWValue(true)}};
    auto installer = daemon.connectAs("com.bench.installer", allowed);
    auto app = daemon.connectAs("com.bench.app", {});
    if (!installer || !app)
        die("cannot connect");
    STWValue::Dictionary install{{"Identifier", STWValue("com.bench.app")},
                                 {"CodeSigningInfo", STWValue(appInfo("com.bench.app", 0))}};
    if (STWDaemonProcess::replyError(*installer, 18, install) != 1 || STWDaemonProcess::replyError(*app, 13) != 1)
        die("cannot set up the app's groups");
    auto lookups = [&] {
        for (size_t g = 0; g < 3; ++g)
            if (STWDaemonProcess::replyError(*installer, 0,
                                             {{"Identifier", STWValue("group.bench." + std::to_string(g))},
                                              {"ContainerClass", STWValue(7)}}) != 1)
                die("command 0");
    };
    auto groups = [&] {
        if (STWDaemonProcess::replyError(*app, 13) != 1)
            die("command 13");
    };
    int batch = 200, rounds = quick ? 5 : 15;
    std::vector<double> ratios;
    for (int round = 0; round < rounds; ++round) {
        double a = timed([&] {
            for (int i = 0; i < batch; ++i)
                groups();
        });
        double b = timed([&] {
            for (int i = 0; i < batch; ++i)
                lookups();
        });
        ratios.push_back(a / b);
    }
    printf("group_lookup: ratio %.2f (goal <= 1.2)\n", median(ratios));
}

} // namespace

int main(int argc, char** argv) {
    bool quick = argc > 1 && strcmp(argv[1], "--quick") == 0;
    try {
        // A root of our own for the mapping in this process (a daemon that never starts
        // lays it out and removes it).
        STWDaemonProcess root({{"DeveloperMode", STWValue(true)}}, {}, false);
        STWErrorRef error;
        auto configuration = STWPlatformConfiguration::loadFromRoot(root.root(), &error);
        if (!configuration)
            die("cannot load the configuration of " + root.root().string());
        STWPlatformConfiguration::setSharedInstance(configuration);
        auto mapping = STWCodeSigningMapping::sharedInstance();
        if (!mapping)
            die("no mapping");
        processApps(*mapping, quick);
        groupSweep(*mapping, quick);
        groupLookup(quick);
    } catch (const std::exception& e) {
        fprintf(stderr, "stowly_bench_codesigning_mapping: %s\n", e.what());
        return 1;
    }
    return 0;
}

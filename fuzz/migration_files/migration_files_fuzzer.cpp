// The readers of the files older daemons left behind, on whatever bytes such a file holds:
// the migration status store (and the marker files it folds in), the legacy code-signing
// mapping file and the legacy entitlements file. None of them crashes, and what each
// accepts keeps its promises:
// - a status file or a marker file is taken in exactly when it is a property-list
//   dictionary, and the store written after a fold reads back as what the store holds;
// - every entry of a mapping file survives its own serialised form unchanged;
// - an entry of an entitlements file has its entitlements as a dictionary under the key
//   the mapping reads, class 0, and is invalid exactly when no caller registered it.
// The first byte picks the marker file; the rest is the content of every file. The files
// are real files in a scratch directory, read as the daemon reads them.
#include "Daemon/CodeSigning/STWCodeSigningEntry.h"
#include "Daemon/CodeSigning/STWCodeSigningMapping.h"
#include "Daemon/Migration/STWMigrationStatus.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWFileIO.h"
#include "common/STWPropertyList.h"

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string_view>

namespace fs = std::filesystem;

namespace {

constexpr std::pair<const char*, const char*> markerFiles[] = {
    {"stw_bundle_migration_complete.plist", STWMigrationType::bundle},
    {"stw_acl2_migration_complete.plist", STWMigrationType::acl},
    {"stw_group_id_migration_complete.plist", STWMigrationType::groupId},
    {"stw_code_signing_migration_complete.plist", STWMigrationType::codeSigning},
};

// tmpfs where there is one: the status store syncs every write.
const fs::path& scratch() {
    static const fs::path path = [] {
        std::string templ = fs::is_directory("/dev/shm") ? "/dev/shm/stowly-fuzz-migration-XXXXXX"
                                                         : "/tmp/stowly-fuzz-migration-XXXXXX";
        if (!mkdtemp(templ.data()))
            abort();
        static fs::path cleanup = templ;
        atexit([] {
            std::error_code ec;
            fs::remove_all(cleanup, ec);
        });
        return fs::path(templ);
    }();
    return path;
}

// A finding aborts, which skips the exit handlers: the scratch directory goes first.
void fail(const char* what) {
    fprintf(stderr, "migration files fuzzer: %s\n", what);
    std::error_code ec;
    fs::remove_all(scratch(), ec);
    abort();
}

void writeFile(const fs::path& url, std::string_view bytes) {
    if (STWWriteFileAtomically(url, bytes, 0644, false) != 0)
        fail("cannot write the scratch file");
}

void clearScratch() {
    std::error_code ec;
    for (const auto& entry : fs::directory_iterator(scratch()))
        fs::remove_all(entry.path(), ec);
}

bool isDictionary(std::string_view bytes) {
    auto value = STWPropertyList::parse(bytes);
    return value && value->isDictionary();
}

void statusFile(std::string_view bytes) {
    clearScratch();
    fs::path url = scratch() / STWMigrationStatus::systemFileName;
    writeFile(url, bytes);
    auto info = STWMigrationStatus::readMigrationInfo(url);
    if (info.has_value() != isDictionary(bytes))
        fail("status file taken in although it is no dictionary, or refused although it is one");
    STWMigrationStatus status(url, true);
    auto held = status.migrationInfo();
    if (info && !info->empty() && (!held || !STWValue(*held).isIdenticalTo(STWValue(*info))))
        fail("a non-empty status file changed when the store was made");
    if (info)
        for (const auto& [name, type] : markerFiles)
            if (status.hasMigrationOccurredForType(type) != (info->count(type) == 1))
                fail("a migration type read differently from the status file");
}

void markerFile(const char* name, const char* type, std::string_view bytes) {
    clearScratch();
    fs::path url = scratch() / STWMigrationStatus::systemFileName;
    writeFile(scratch() / name, bytes);
    STWMigrationStatus status(url, true);
    if (status.hasMigrationOccurredForType(type) != isDictionary(bytes))
        fail("a marker file folded in although it is no dictionary, or left out although it is one");
    // The fold wrote the store (the scratch directory takes every write) and then
    // removed the markers.
    if (fs::exists(scratch() / name))
        fail("a folded marker file is still there");
    auto written = STWMigrationStatus::readMigrationInfo(url);
    auto held = status.migrationInfo();
    if (!written || !held || !STWValue(*written).isIdenticalTo(STWValue(*held))) {
        fprintf(stderr, "held: %s\nwritten: %s\n", held ? STWValue(*held).description().c_str() : "(none)",
                written ? STWValue(*written).description().c_str() : "(none)");
        fail("the folded store reads back differently");
    }
}

void mappingFile(std::string_view bytes) {
    clearScratch();
    fs::path url = scratch() / STWCodeSigningMapping::legacyMappingFileName;
    writeFile(url, bytes);
    auto mapping = STWCodeSigningMapping::_readCodeSigningMappingFromDiskAtURL(url);
    if (mapping.has_value() != isDictionary(bytes))
        fail("mapping file taken in although it is no dictionary, or refused although it is one");
    if (!mapping)
        return;
    for (const auto& [identifier, value] : *mapping) {
        const STWValue::Dictionary* serialized = value.dictionary();
        if (!serialized)
            continue; // the migration skips it
        STWCodeSigningEntry entry = STWCodeSigningEntry::initWithSerializedDictionary(*serialized);
        STWValue::Dictionary again = entry.serialize();
        STWCodeSigningEntry reread = STWCodeSigningEntry::initWithSerializedDictionary(again);
        if (!STWValue(reread.serialize()).isIdenticalTo(STWValue(again)))
            fail("an entry of the mapping file changed through its own serialised form");
        (void)entry.description();
        (void)entry.hash();
    }
}

void entitlementsFile(std::string_view bytes) {
    clearScratch();
    fs::path url = scratch() / STWCodeSigningMapping::legacyEntitlementsFileName;
    writeFile(url, bytes);
    STWErrorRef error;
    auto file = STW_dictionaryWithContentsOfURL(url, 0, &error);
    if (!file)
        return;
    auto entries = STWCodeSigningMapping::_codeSigningEntriesFromLegacyEntitlements(*file);
    if (entries.size() > file->size())
        fail("more entries than keys");
    const STWValue::Dictionary* registered = nullptr;
    if (const STWValue* value = STWDictionaryFind(*file, "com.vorlane.Stowly.EntitlementsRegisteredByCaller"))
        registered = value->dictionary();
    for (const auto& [identifier, entry] : entries) {
        if (identifier.rfind("com.vorlane.Stowly.", 0) == 0 &&
            (identifier == "com.vorlane.Stowly.ChildPluginBundleIDs" ||
             identifier == "com.vorlane.Stowly.EntitlementsRegisteredByCaller" ||
             identifier == "com.vorlane.Stowly.PlaceholderEntitlements"))
            fail("a bookkeeping key became an entry");
        const STWValue* original = STWDictionaryFind(*file, identifier);
        if (!entry.codeSigningInfo() || entry.codeSigningInfo()->size() != 1 || !original ||
            !STWDictionaryDictionary(*entry.codeSigningInfo(), STWEntitlementKey::entitlements) ||
            !STWDictionaryFind(*entry.codeSigningInfo(), STWEntitlementKey::entitlements)
                 ->isIdenticalTo(*original))
            fail("an entry's info is not the file's entitlements dictionary");
        if (entry.dataContainerClass() != 0 || entry.advanceCopy())
            fail("an entry with a class or as an advance copy");
        bool byCaller = registered && STWDictionaryBool(*registered, identifier);
        if (entry.registeredByCaller() != byCaller || entry.invalid() == byCaller)
            fail("registered-by-caller and invalid do not follow the file");
    }
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size == 0)
        return 0;
    const auto& [name, type] = markerFiles[data[0] % std::size(markerFiles)];
    std::string_view bytes(reinterpret_cast<const char*>(data + 1), size - 1);
    statusFile(bytes);
    markerFile(name, type, bytes);
    mappingFile(bytes);
    entitlementsFile(bytes);
    return 0;
}

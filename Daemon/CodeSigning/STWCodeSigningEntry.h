// What the daemon knows about one code-signing identifier: the installer's code-signing
// info dictionary (above all the entitlements), the data-container class, the identifiers
// of the child bundles (plug-ins) that belong to it and four state flags.
//
// A plain value: the code-signing database stores and returns entries, the code-signing
// mapping builds them from installer updates and compares them with what is stored to
// decide whether anything changed, so equality and hash go by value.
#pragma once

#include "common/STWValue.h"

#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

class STWCodeSigningEntry {
public:
    // An entry with no info dictionary: what the mapping uses for "nothing stored".
    STWCodeSigningEntry() = default;
    // The flags and the child list start cleared.
    explicit STWCodeSigningEntry(std::optional<STWValue::Dictionary> codeSigningInfo,
                                 uint64_t dataContainerClass = 0);

    // The identifier's bundle is gone; the entry is kept but hidden from external queries.
    bool invalid() const { return _invalid; }
    void setInvalid(bool invalid) { _invalid = invalid; }
    // Written for a placeholder installation.
    bool placeholder() const { return _placeholder; }
    void setPlaceholder(bool placeholder) { _placeholder = placeholder; }
    // Written ahead of an installation that has not completed; purged at boot.
    bool advanceCopy() const { return _advanceCopy; }
    void setAdvanceCopy(bool advanceCopy) { _advanceCopy = advanceCopy; }
    // The entitlements came from the client itself rather than from the installer.
    bool registeredByCaller() const { return _registeredByCaller; }
    void setRegisteredByCaller(bool registeredByCaller) { _registeredByCaller = registeredByCaller; }

    const std::optional<STWValue::Dictionary>& codeSigningInfo() const { return _codeSigningInfo; }
    void setCodeSigningInfo(std::optional<STWValue::Dictionary> codeSigningInfo) {
        _codeSigningInfo = std::move(codeSigningInfo);
    }
    const std::optional<std::vector<std::string>>& childBundleIdentifiers() const {
        return _childBundleIdentifiers;
    }
    void setChildBundleIdentifiers(std::optional<std::vector<std::string>> childBundleIdentifiers) {
        _childBundleIdentifiers = std::move(childBundleIdentifiers);
    }
    // Container class of the identifier's data container; 0 when unknown.
    uint64_t dataContainerClass() const { return _dataContainerClass; }
    void setDataContainerClass(uint64_t dataContainerClass) { _dataContainerClass = dataContainerClass; }

    // The dictionary form of the legacy mapping file: "CodeSigningInfo", "ChildBundleIds",
    // "Invalid", "Placeholder", "AdvanceCopy", "RegisteredByCaller", "DataContainerClass".
    // Missing or mistyped keys read as absent, false or 0; child identifiers that are not
    // strings are dropped.
    STWValue::Dictionary serialize() const;
    static STWCodeSigningEntry initWithSerializedDictionary(const STWValue::Dictionary& serialized);

    // Two absent dictionaries (or child lists) compare equal; child order matters.
    bool operator==(const STWCodeSigningEntry& other) const;
    size_t hash() const;
    std::string description() const;

private:
    bool _invalid = false;
    bool _placeholder = false;
    bool _advanceCopy = false;
    bool _registeredByCaller = false;
    std::optional<STWValue::Dictionary> _codeSigningInfo;
    std::optional<std::vector<std::string>> _childBundleIdentifiers;
    uint64_t _dataContainerClass = 0;
};

template <>
struct std::hash<STWCodeSigningEntry> {
    size_t operator()(const STWCodeSigningEntry& entry) const { return entry.hash(); }
};

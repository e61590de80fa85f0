#include "Daemon/CodeSigning/STWCodeSigningEntry.h"
#include "common/STWSystemCall.h"

#include "common/STWFormat.h"

namespace {

// An absent value hashes as 0, so "no child list" and "no dictionary" drop out of the XOR.
size_t hashChildren(const std::optional<std::vector<std::string>>& children) {
    if (!children)
        return 0;
    size_t seed = std::hash<size_t>()(children->size());
    for (const std::string& child : *children)
        seed = STWHashCombine(seed, std::hash<std::string>()(child));
    return seed;
}

size_t hashDictionary(const std::optional<STWValue::Dictionary>& dictionary) {
    if (!dictionary)
        return 0;
    size_t seed = std::hash<size_t>()(dictionary->size());
    for (const auto& [key, value] : *dictionary)
        seed = STWHashCombine(STWHashCombine(seed, std::hash<std::string>()(key)), value.hash());
    return seed;
}

char yesNo(bool flag) {
    return flag ? 'Y' : 'N';
}

} // namespace

STWCodeSigningEntry::STWCodeSigningEntry(std::optional<STWValue::Dictionary> codeSigningInfo,
                                         uint64_t dataContainerClass)
    : _codeSigningInfo(std::move(codeSigningInfo)), _dataContainerClass(dataContainerClass) {}

bool STWCodeSigningEntry::operator==(const STWCodeSigningEntry& other) const {
    return _codeSigningInfo == other._codeSigningInfo &&
           _childBundleIdentifiers == other._childBundleIdentifiers && _invalid == other._invalid &&
           _placeholder == other._placeholder && _advanceCopy == other._advanceCopy &&
           _registeredByCaller == other._registeredByCaller &&
           _dataContainerClass == other._dataContainerClass;
}

size_t STWCodeSigningEntry::hash() const {
    size_t value = hashChildren(_childBundleIdentifiers) ^ hashDictionary(_codeSigningInfo);
    if (_invalid)
        value += 2;
    if (_placeholder)
        value += 4;
    if (_registeredByCaller)
        value += 8;
    if (_dataContainerClass != 0)
        value += 16;
    if (_advanceCopy)
        value += 32;
    return value;
}

std::string STWCodeSigningEntry::description() const {
    std::string children = "(null)";
    if (_childBundleIdentifiers) {
        STWValue::Array array(_childBundleIdentifiers->begin(), _childBundleIdentifiers->end());
        children = STWValue(std::move(array)).description();
    }
    std::string info = _codeSigningInfo ? STWDescribeDictionary(*_codeSigningInfo) : "(null)";
    return STWFormat(
        "<%@ invalid: %c, placeholder: %c, advanceCopy: %c, regByCaller: %c, dataClass: %llu, childBundles: "
        "%@, CSinfo: %@>",
        "STWCodeSigningEntry", yesNo(_invalid), yesNo(_placeholder), yesNo(_advanceCopy),
        yesNo(_registeredByCaller), _dataContainerClass, children, info);
}

STWValue::Dictionary STWCodeSigningEntry::serialize() const {
    STWValue::Dictionary serialized{{"Invalid", STWValue(_invalid)},
                                    {"Placeholder", STWValue(_placeholder)},
                                    {"AdvanceCopy", STWValue(_advanceCopy)},
                                    {"RegisteredByCaller", STWValue(_registeredByCaller)},
                                    {"DataContainerClass", STWValue(_dataContainerClass)}};
    if (_codeSigningInfo)
        serialized["CodeSigningInfo"] = STWValue(*_codeSigningInfo);
    if (_childBundleIdentifiers)
        serialized["ChildBundleIds"] =
            STWValue(STWValue::Array(_childBundleIdentifiers->begin(), _childBundleIdentifiers->end()));
    return serialized;
}

STWCodeSigningEntry STWCodeSigningEntry::initWithSerializedDictionary(const STWValue::Dictionary& serialized) {
    std::optional<STWValue::Dictionary> info;
    if (const STWValue::Dictionary* d = STWDictionaryDictionary(serialized, "CodeSigningInfo"))
        info = *d;
    STWCodeSigningEntry entry(std::move(info), STWDictionaryUInt64(serialized, "DataContainerClass").value_or(0));
    if (const STWValue* children = STWDictionaryFind(serialized, "ChildBundleIds"); children && children->array()) {
        std::vector<std::string> identifiers;
        for (const STWValue& child : *children->array())
            if (const std::string* s = child.string())
                identifiers.push_back(*s);
        entry.setChildBundleIdentifiers(std::move(identifiers));
    }
    entry.setInvalid(STWDictionaryBool(serialized, "Invalid"));
    entry.setPlaceholder(STWDictionaryBool(serialized, "Placeholder"));
    entry.setAdvanceCopy(STWDictionaryBool(serialized, "AdvanceCopy"));
    entry.setRegisteredByCaller(STWDictionaryBool(serialized, "RegisteredByCaller"));
    return entry;
}

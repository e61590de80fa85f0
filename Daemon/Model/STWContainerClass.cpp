#include "Daemon/Model/STWContainerClass.h"

namespace {

constexpr std::string_view directoryNames[] = {
    "Undefined",          "Bundle/Application", "Data/Application",   "Bundle/QuilletPlugin", "Data/QuilletPlugin",
    "Bundle/VPNPlugin",   "Data/VPNPlugin",     "Shared/AppGroup",    "Bundle/Framework",     "Data/TolvanService",
    "Data/InternalDaemon", "Data/TempDir",      "Data/System",        "Shared/SystemGroup",   "MAX",
};

constexpr std::string_view lookupWords[] = {
    "",          "app",           "appData", "plugin",  "pluginData", "vpn",        "vpnData",
    "appGroup",  "framework",     "tolvanService",      "daemon",     "tempDir",    "systemData", "systemGroup",
};

bool inSet(STWContainerClass c, uint32_t mask) { return c < 32 && (mask >> c) & 1; }

constexpr uint32_t bit(unsigned n) { return 1u << n; }

} // namespace

bool STWContainerClassIsValid(STWContainerClass c) { return c >= 1 && c <= 13; }

bool STWContainerClassIsBundle(STWContainerClass c) { return inSet(c, bit(1) | bit(3) | bit(5) | bit(8)); }

bool STWContainerClassIsSystem(STWContainerClass c) { return (c | 1) == 13; }

bool STWContainerClassIsGlobal(STWContainerClass c) {
    return STWContainerClassIsBundle(c) || STWContainerClassIsSystem(c);
}

bool STWContainerClassIsPerUser(STWContainerClass c) {
    return inSet(c, bit(2) | bit(4) | bit(6) | bit(7) | bit(9) | bit(10) | bit(11));
}

bool STWContainerClassIsChildData(STWContainerClass c) { return inSet(c, bit(4) | bit(6)); }

bool STWContainerClassIsGroup(STWContainerClass c) { return inSet(c, bit(7) | bit(13)); }

bool STWContainerClassTakesContainerExtension(STWContainerClass c) {
    return inSet(c, bit(2) | bit(4) | bit(6) | bit(10));
}

bool STWContainerClassRegistersOnlyForEntitledUsers(STWContainerClass c) {
    return inSet(c, bit(2) | bit(4) | bit(6) | bit(9) | bit(10) | bit(11));
}

STWContainerClass STWContainerClassDataClassForBundleClass(STWContainerClass c) {
    return inSet(c, bit(1) | bit(3) | bit(5)) ? c + 1 : STWContainerClassUndefined;
}

std::string_view STWContainerClassDirectoryName(STWContainerClass c) {
    return c < std::size(directoryNames) ? directoryNames[c] : std::string_view();
}

std::string_view STWContainerClassLookupWord(STWContainerClass c) {
    return c < std::size(lookupWords) ? lookupWords[c] : std::string_view();
}

std::optional<uint32_t> STWContainerClassSandboxItemType(STWContainerClass c) {
    if (STWContainerClassIsPerUser(c))
        return c == STWContainerClassSharedAppGroup ? 2 : 1;
    if (c == STWContainerClassDataSystem)
        return 4;
    if (c == STWContainerClassSharedSystemGroup)
        return 8;
    return std::nullopt;
}

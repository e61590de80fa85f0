#include "tests/support/STWTestRoot.h"
#include "Daemon/FileSystem/STWFileManager.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWPropertyList.h"
#include "platform/STWPlatformConfiguration.h"

#include <cstdlib>
#include <fstream>
#include <gtest/gtest.h>

// A death test's child process runs the test binary anew and would make (and, dying,
// leave behind) a root of its own; it takes over its parent's instead.
constexpr const char* kInheritedRootVariable = "STOWLY_TEST_ROOT";

STWTestRoot& STWTestRoot::shared() {
    static STWTestRoot* root = [] {
        const char* inherited = getenv(kInheritedRootVariable);
        if (inherited && std::filesystem::is_directory(inherited))
            return new STWTestRoot(inherited);
        auto* r = new STWTestRoot(std::nullopt);
        setenv(kInheritedRootVariable, r->path().c_str(), 1);
        static std::filesystem::path cleanup = r->path();
        atexit([] { STWFileManager::defaultManager()->removeItemAtURL(cleanup); });
        return r;
    }();
    return *root;
}

STWTestRoot::STWTestRoot(const std::optional<std::filesystem::path>& existing) {
    if (existing) {
        _path = *existing;
        _reload();
        return;
    }
    char templ[] = "/tmp/stowly-test-root-XXXXXX";
    if (!mkdtemp(templ))
        abort();
    _path = templ;
    std::filesystem::permissions(_path, std::filesystem::perms(0755));
    std::filesystem::create_directories(_path / "etc/stowly");
    std::filesystem::create_directories(_path / "private/var/mobile");
    std::ofstream(_path / "etc/passwd") << "root:x:0:0:root:/private/var/root:/bin/sh\n"
                                           "mobile:x:501:501:Mobile:/private/var/mobile:/bin/sh\n"
                                           "other:x:502:502:Other:/private/var/other:/bin/sh\n";
    std::ofstream(_path / "etc/group") << "root:x:0:\nmobile:x:501:\nsystemusers:x:950:mobile\n";
    _reload();
}

std::filesystem::path STWTestRoot::resolve(const std::filesystem::path& absolute) const {
    return _path / absolute.relative_path();
}

void STWTestRoot::writeSettings(const STWValue::Dictionary& settings) {
    if (!STW_writeToURL(settings, _path / "etc/stowly/stowlyd.plist", STWWriteAtomic, nullptr))
        abort();
    _reload();
}

void STWTestRoot::writePersonas(const STWValue::Array& personas) {
    // Atomic, so that a watcher never reads half a file.
    std::string bytes = STWPropertyList::serializeBinary(STWValue(personas));
    if (STWWriteFileAtomically(_path / "etc/stowly/personas.plist", bytes, 0644, false) != 0)
        abort();
}

void STWTestRoot::_reload() {
    STWErrorRef error;
    auto configuration = STWPlatformConfiguration::loadFromRoot(_path, &error);
    if (!configuration)
        abort();
    STWPlatformConfiguration::setSharedInstance(configuration);
}

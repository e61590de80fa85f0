#include "platform/STWKeybag.h"

#include "common/STWFileIO.h"
#include "platform/STWFileWatcher.h"
#include "platform/STWPlatformConfiguration.h"

#include <atomic>
#include <string>
#include <string_view>

namespace {

// -1: no override, 0: unlocked, 1: locked.
std::atomic<int> lockOverride{-1};

std::string_view trimmed(std::string_view text) {
    const char* space = " \t\r\n";
    size_t begin = text.find_first_not_of(space);
    if (begin == std::string_view::npos)
        return {};
    size_t end = text.find_last_not_of(space);
    return text.substr(begin, end - begin + 1);
}

} // namespace

bool STWKeybag::isDeviceLocked() {
    int forced = lockOverride.load(std::memory_order_relaxed);
    if (forced >= 0)
        return forced == 1;
    std::string contents;
    auto file = STWPlatformConfiguration::sharedInstance()->runtimeDirectory() / "keybag";
    // The file holds one short word; anything that cannot be read counts as unlocked,
    // like a missing file.
    if (STWReadFileContents(file, &contents, STWReadNoFollow, 64) != 0)
        return false;
    return trimmed(contents) == "locked";
}

void STWKeybag::setLockStateOverrideForTesting(std::optional<bool> locked) {
    lockOverride.store(locked ? (*locked ? 1 : 0) : -1, std::memory_order_relaxed);
}

bool STWKeybag::registerForLockStateNotifications(std::function<void()> callback) {
    auto directory = STWPlatformConfiguration::sharedInstance()->runtimeDirectory();
    int token = STWFileWatcher::sharedInstance().addWatch(directory, [callback](const std::string& name) {
        if (name == "keybag" || name.empty()) // empty: changes were lost, read it again
            callback();
    });
    return token >= 0;
}

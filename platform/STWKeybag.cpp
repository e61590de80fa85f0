#include "platform/STWKeybag.h"

#include "common/STWFileDescriptor.h"
#include "common/STWFileIO.h"
#include "common/STWThreadSafety.h"
#include "platform/STWFileWatcher.h"
#include "platform/STWPlatformConfiguration.h"

#include <atomic>
#include <cerrno>
#include <cstring>
#include <limits.h>
#include <memory>
#include <string>
#include <string_view>
#include <sys/inotify.h>
#include <unistd.h>

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

// The file holds one short word; anything that cannot be read counts as unlocked, like a
// missing file.
bool readStateFile(const std::filesystem::path& directory) {
    std::string contents;
    if (STWReadFileContents(directory / "keybag", &contents, STWReadNoFollow, 64) != 0)
        return false;
    return trimmed(contents) == "locked";
}

// The file layer asks for the state on every protection-class change, so a walk over a
// container asks once per item, and reading the file each time costs a path lookup from
// the root. The state read last is kept while an inotify watch on the runtime directory
// reports no change to the file. The kernel queues the event before the system call that
// changed the file returns, so the kept state is never older than a read of the file
// would be. Without a directory to watch, every call reads the file. The shared file
// watcher cannot serve here: its callbacks run later on the event loop, and a class change
// in between would see the old state.
class StateCache {
public:
    bool locked() {
        auto configuration = STWPlatformConfiguration::sharedInstance();
        STWLockGuard guard(_lock);
        if (configuration != _configuration) {
            _configuration = configuration;
            _directory = configuration->runtimeDirectory();
            _watch.reset();
        }
        if (!_watch) {
            // Watch first, then read: a change after the read is then always seen.
            STWFileDescriptor fd(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
            if (fd && inotify_add_watch(fd.get(), _directory.c_str(),
                                        IN_CLOSE_WRITE | IN_MODIFY | IN_CREATE | IN_DELETE | IN_MOVED_FROM |
                                            IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR) >= 0)
                _watch = std::move(fd);
            _valid = false;
            if (!_watch)
                return readStateFile(_directory);
        }
        if (_lock_changed())
            _valid = false;
        if (!_watch)
            return readStateFile(_directory);
        if (!_valid) {
            _locked = readStateFile(_directory);
            _valid = true;
        }
        return _locked;
    }

private:
    // Drains the watch: true when the file may have changed. A lost or ended watch is
    // dropped, to be set up again by the next call.
    bool _lock_changed() STW_REQUIRES(_lock) {
        alignas(struct inotify_event) char buffer[4096];
        bool changed = false;
        while (true) {
            ssize_t n = read(_watch.get(), buffer, sizeof buffer);
            if (n <= 0) {
                if (n < 0 && errno != EAGAIN && errno != EINTR) {
                    _watch.reset();
                    return true;
                }
                return changed;
            }
            for (char* p = buffer; p < buffer + n;) {
                auto* event = reinterpret_cast<struct inotify_event*>(p);
                if (event->mask & (IN_Q_OVERFLOW | IN_IGNORED | IN_DELETE_SELF | IN_MOVE_SELF)) {
                    _watch.reset();
                    return true;
                }
                if (event->len && strcmp(event->name, "keybag") == 0)
                    changed = true;
                p += sizeof(struct inotify_event) + event->len;
            }
        }
    }

    STWMutex _lock;
    std::shared_ptr<const STWPlatformConfiguration> _configuration STW_GUARDED_BY(_lock);
    std::filesystem::path _directory STW_GUARDED_BY(_lock);
    STWFileDescriptor _watch STW_GUARDED_BY(_lock);
    bool _valid STW_GUARDED_BY(_lock) = false;
    bool _locked STW_GUARDED_BY(_lock) = false;
};

} // namespace

bool STWKeybag::isDeviceLocked() {
    int forced = lockOverride.load(std::memory_order_relaxed);
    if (forced >= 0)
        return forced == 1;
    static StateCache* cache = new StateCache; // lives for the process, like the watch
    return cache->locked();
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

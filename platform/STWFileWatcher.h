// Watches directories for changes with inotify and calls back on the event loop
// (STWEventLoop::main()). Used by the stand-ins whose platform service would push change
// notifications (persona list, keybag, client registry).
//
// The kernel holds a bounded queue of events for the watcher; when it overflows, events
// are lost and nobody can tell which files changed. Then every callback is called with an
// empty name, and each re-reads whatever it follows, so no change goes unnoticed.
//
// Threads: addWatch and removeWatch from any thread; `_lock` guards the table of watches,
// which the loop reads to dispatch. Callbacks run on the loop, one at a time, so they must
// not block (see STWEventLoop.h).
#pragma once

#include "common/STWFileDescriptor.h"
#include "common/STWThreadSafety.h"
#include "platform/STWEventLoop.h"

#include <condition_variable>
#include <filesystem>
#include <functional>
#include <map>
#include <string>

class STWFileWatcher {
public:
    // `name` is the entry that changed, or empty when events were lost.
    using Callback = std::function<void(const std::string& name)>;

    static STWFileWatcher& sharedInstance();

    // Calls `callback` with the entry name whenever an entry of `directory` is created,
    // written, renamed or removed. The directory must exist. Returns a token for
    // removeWatch, or -1 with errno set.
    int addWatch(const std::filesystem::path& directory, Callback callback) STW_EXCLUDES(_lock);
    // Once it returns, the callback is not running and is never called again (called from
    // a callback, it cannot wait for that callback itself to return).
    void removeWatch(int token) STW_EXCLUDES(_lock);

private:
    struct Watch {
        int descriptor;
        Callback callback;
    };

    STWFileWatcher();
    void _readEvents() STW_EXCLUDES(_lock);

    STWFileDescriptor _inotify;
    STWEventLoop::Source _source; // made and used on the loop

    STWMutex _lock;
    std::condition_variable _dispatchEnded;
    int _lock_nextToken STW_GUARDED_BY(_lock) = 1;
    std::map<int, Watch> _lock_watches STW_GUARDED_BY(_lock); // by token
    bool _lock_dispatching STW_GUARDED_BY(_lock) = false;
};

#include "platform/STWFileWatcher.h"

#include "common/STWLog.h"

#include <cerrno>
#include <cstring>
#include <sys/inotify.h>
#include <unistd.h>
#include <utility>
#include <vector>

namespace {

// Set on the loop while callbacks run, so that removeWatch from a callback does not wait
// for itself.
thread_local bool dispatchingHere = false;

} // namespace

STWFileWatcher& STWFileWatcher::sharedInstance() {
    static STWFileWatcher* watcher = new STWFileWatcher; // the loop uses it up to exit
    return *watcher;
}

STWFileWatcher::STWFileWatcher() {
    _inotify.reset(inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
    if (!_inotify) {
        STW_LOG_ERROR(STWLogCategory::Unspecified, "inotify_init1 failed: %s", strerror(errno));
        return;
    }
    // Sources are made on the loop. Events that arrive before it runs wait in the kernel.
    STWEventLoop::main().post([this] {
        _source = STWEventLoop::main().watchReadable(_inotify.get(), [this] { _readEvents(); });
        if (!_source)
            STW_LOG_ERROR(STWLogCategory::Unspecified, "Cannot watch inotify on the event loop: %s",
                          strerror(errno));
    });
}

int STWFileWatcher::addWatch(const std::filesystem::path& directory, Callback callback) {
    if (!_inotify) {
        errno = ENOSYS;
        return -1;
    }
    int descriptor =
        inotify_add_watch(_inotify.get(), directory.c_str(),
                          IN_CLOSE_WRITE | IN_MOVED_TO | IN_MOVED_FROM | IN_CREATE | IN_DELETE | IN_ONLYDIR);
    if (descriptor < 0)
        return -1;
    STWLockGuard guard(_lock);
    int token = _lock_nextToken++;
    _lock_watches[token] = Watch{descriptor, std::move(callback)};
    return token;
}

void STWFileWatcher::removeWatch(int token) {
    STWUniqueLock lock(_lock);
    auto it = _lock_watches.find(token);
    if (it == _lock_watches.end())
        return;
    int descriptor = it->second.descriptor;
    _lock_watches.erase(it);
    bool shared = false; // inotify has one descriptor per directory
    for (const auto& [other, watch] : _lock_watches)
        shared = shared || watch.descriptor == descriptor;
    if (!shared)
        inotify_rm_watch(_inotify.get(), descriptor);
    if (!dispatchingHere)
        _dispatchEnded.wait(lock.native(), [&] {
            _lock.assertHeld();
            return !_lock_dispatching;
        });
}

void STWFileWatcher::_readEvents() {
    // One read per wake-up: the loop comes back while more are queued, and serves the
    // sockets in between.
    alignas(inotify_event) char buffer[16384];
    ssize_t n = read(_inotify.get(), buffer, sizeof buffer);
    if (n < 0) {
        if (errno != EAGAIN && errno != EINTR)
            STW_LOG_ERROR(STWLogCategory::Unspecified, "inotify read failed: %s", strerror(errno));
        return;
    }
    std::vector<std::pair<int, std::string>> calls; // token, entry name
    bool overflowed = false;
    {
        STWLockGuard guard(_lock);
        for (char* p = buffer; p < buffer + n;) {
            auto* event = reinterpret_cast<inotify_event*>(p);
            p += sizeof(inotify_event) + event->len;
            if (event->mask & IN_Q_OVERFLOW) {
                overflowed = true;
                continue;
            }
            for (const auto& [token, watch] : _lock_watches)
                if (watch.descriptor == event->wd)
                    calls.emplace_back(token, event->len ? std::string(event->name) : std::string());
        }
        if (overflowed) {
            calls.clear();
            for (const auto& [token, watch] : _lock_watches)
                calls.emplace_back(token, std::string());
        }
        _lock_dispatching = true;
    }
    if (overflowed)
        STW_LOG_ERROR(
            STWLogCategory::Unspecified,
            "File change events were lost (inotify queue overflow): %llu watches re-read what they follow",
            static_cast<unsigned long long>(calls.size()));
    dispatchingHere = true;
    for (const auto& [token, name] : calls) {
        Callback callback;
        {
            STWLockGuard guard(_lock);
            auto it = _lock_watches.find(token);
            if (it == _lock_watches.end())
                continue; // removed by an earlier callback
            callback = it->second.callback;
        }
        callback(name);
    }
    dispatchingHere = false;
    {
        STWLockGuard guard(_lock);
        _lock_dispatching = false;
    }
    _dispatchEnded.notify_all();
}

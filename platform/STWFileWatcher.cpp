#include "platform/STWFileWatcher.h"

#include "common/STWLog.h"

#include <cerrno>
#include <cstring>
#include <map>
#include <mutex>
#include <sys/inotify.h>
#include <thread>
#include <unistd.h>

struct STWFileWatcher::State {
    int fd = -1;
    std::mutex mutex;
    int nextToken = 1;
    struct Watch {
        int descriptor;
        Callback callback;
    };
    std::map<int, Watch> watches; // token -> watch
};

STWFileWatcher& STWFileWatcher::sharedInstance() {
    static STWFileWatcher* watcher = new STWFileWatcher; // its thread runs until exit
    return *watcher;
}

STWFileWatcher::STWFileWatcher() : _state(new State) {
    _state->fd = inotify_init1(IN_CLOEXEC);
    if (_state->fd < 0) {
        STW_LOG_ERROR(STWLogCategory::Unspecified, "inotify_init1 failed: %s", strerror(errno));
        return;
    }
    std::thread([this] { _run(); }).detach();
}

int STWFileWatcher::addWatch(const std::filesystem::path& directory, Callback callback) {
    if (_state->fd < 0) {
        errno = ENOSYS;
        return -1;
    }
    int descriptor = inotify_add_watch(_state->fd, directory.c_str(),
                                       IN_CLOSE_WRITE | IN_MOVED_TO | IN_MOVED_FROM | IN_CREATE | IN_DELETE | IN_ONLYDIR);
    if (descriptor < 0)
        return -1;
    std::lock_guard guard(_state->mutex);
    int token = _state->nextToken++;
    _state->watches[token] = State::Watch{descriptor, std::move(callback)};
    return token;
}

void STWFileWatcher::removeWatch(int token) {
    std::lock_guard guard(_state->mutex);
    auto it = _state->watches.find(token);
    if (it == _state->watches.end())
        return;
    int descriptor = it->second.descriptor;
    _state->watches.erase(it);
    for (const auto& [t, w] : _state->watches)
        if (w.descriptor == descriptor)
            return; // inotify shares one descriptor per directory
    inotify_rm_watch(_state->fd, descriptor);
}

void STWFileWatcher::_run() {
    alignas(inotify_event) char buffer[16384];
    while (true) {
        ssize_t n = read(_state->fd, buffer, sizeof buffer);
        if (n < 0) {
            if (errno == EINTR)
                continue;
            STW_LOG_ERROR(STWLogCategory::Unspecified, "inotify read failed: %s", strerror(errno));
            return;
        }
        for (char* p = buffer; p < buffer + n;) {
            auto* event = reinterpret_cast<inotify_event*>(p);
            p += sizeof(inotify_event) + event->len;
            std::string name = event->len ? std::string(event->name) : std::string();
            std::vector<Callback> callbacks;
            {
                std::lock_guard guard(_state->mutex);
                for (const auto& [token, watch] : _state->watches)
                    if (watch.descriptor == event->wd)
                        callbacks.push_back(watch.callback);
            }
            for (const Callback& callback : callbacks)
                callback(name);
        }
    }
}

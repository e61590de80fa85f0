// Watches directories for changes with inotify and calls back on a thread of its own.
// Used by the stand-ins whose platform service would push change notifications
// (persona list, keybag, client registry).
#pragma once

#include <filesystem>
#include <functional>
#include <string>

class STWFileWatcher {
public:
    using Callback = std::function<void(const std::string& name)>;

    static STWFileWatcher& sharedInstance();

    // Calls `callback` with the entry name whenever an entry of `directory` is created,
    // written, renamed or removed. The directory must exist. Returns a token for
    // removeWatch, or -1 with errno set.
    int addWatch(const std::filesystem::path& directory, Callback callback);
    void removeWatch(int token);

private:
    STWFileWatcher();
    void _run();
    struct State;
    State* _state;
};

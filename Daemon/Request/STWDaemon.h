// The daemon process: its entry point, the one-time start-up work, the request socket
// and the device lock-state watch. Start-up runs once, on the main thread, before any
// request is served; connections made meanwhile wait in the socket's backlog, since the
// main thread accepts only once it runs its event loop (STWEventLoop), after start-up.
#pragma once

#include "platform/STWQueue.h"

#include <chrono>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>

class STWDaemon {
public:
    // `stowlyd [--root DIR] [--idle-timeout SECONDS]`.
    static int main(int argc, char** argv);

    static bool initialisationFinished();

    // Follows the device's lock state: suspends the lock-state queue when the device
    // locks and resumes it when it unlocks, strictly alternating. Runs on the main thread
    // (on its event loop, or in start-up before the loop runs), so never concurrently.
    static void keybag_notification_callback();
    // The last lock state seen: 0 unlocked, 1 locked, 3 not yet known.
    static int storedLockState();

private:
    static void _onceInitialization();
    static void _runOnceInitialization();
};

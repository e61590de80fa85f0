// The daemon's event loop: an sd-event loop that the main thread runs once start-up is
// done. It waits for everything that has no client thread of its own (connections on the
// sockets, SIGTERM and SIGINT, the idle timer, the file watches) and for nothing else, so
// an idle daemon sleeps in one epoll_wait until something happens.
//
// Who uses it: STWDaemon runs it; STWIPCListener accepts on it and reaps its connection
// threads there; STWFileWatcher reads inotify on it; STWIdleExitTimer times idle exit.
//
// Threads: sources are made, changed and destroyed on the loop's thread, or by their owner
// while the loop is not running (sd-event is not thread-safe). Any thread hands work to the
// loop with post(). Work on the loop never waits for a client, for the device to unlock or
// on a lock that someone holds across I/O: while it waits, nobody is accepted.
//
// Failures answer as a system call does, with errno set; sd-event's negative errno values
// do not leave this class.
#pragma once

#include "common/STWFileDescriptor.h"
#include "common/STWThreadSafety.h"

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <thread>
#include <vector>

typedef struct sd_event sd_event;
typedef struct sd_event_source sd_event_source;

class STWEventLoop {
public:
    // One event source with its handler; removed from the loop when destroyed. A handler
    // that throws stops the process, as work on a queue does; a handler never destroys
    // its own source.
    class Source {
    public:
        Source() = default;
        ~Source() { reset(); }
        Source(Source&& other) noexcept;
        Source& operator=(Source&& other) noexcept;
        Source(const Source&) = delete;
        Source& operator=(const Source&) = delete;

        explicit operator bool() const { return _source != nullptr; }
        void reset();
        // An I/O or signal source that is off is not dispatched until turned on again.
        void setEnabled(bool enabled);
        // Timers: fire once at `when`, replacing any time set before; disarm() turns off.
        void armAt(std::chrono::steady_clock::time_point when);
        void disarm() { setEnabled(false); }

    private:
        friend class STWEventLoop;
        sd_event_source* _source = nullptr;
        std::unique_ptr<std::function<void()>> _handler;
    };

    // The process's loop, run by the daemon's main thread. Lives until the process exits.
    static STWEventLoop& main();

    STWEventLoop();
    ~STWEventLoop();
    STWEventLoop(const STWEventLoop&) = delete;
    STWEventLoop& operator=(const STWEventLoop&) = delete;

    // Each answers an empty source, with errno set, when sd-event refuses.
    // `handler` runs whenever `fd` is readable (level-triggered: until it is drained). With
    // `edgeTriggered` it runs once each time new data arrives, and whoever it hands the
    // reading to must read until EAGAIN.
    Source watchReadable(int fd, std::function<void()> handler, bool edgeTriggered = false);
    // `handler` runs for each delivery of `signal`, which every thread must block.
    Source watchSignal(int signal, std::function<void()> handler);
    // A one-shot timer on the monotonic clock (steady_clock), off until armed.
    Source timer(std::function<void()> handler);

    // Runs `work` on the loop's thread after everything posted before it. Any thread; work
    // posted while the loop is not running waits for it to run.
    void post(std::function<void()> work) STW_EXCLUDES(_lock);

    // Dispatches events until exit(); answers the code given to exit() (0 or more), or -1
    // when waiting for events failed. The loop can run again afterwards.
    int run();
    // Makes run() return `code` (0 or more) once the current handler is done. Loop thread only.
    void exit(int code);
    // True on the thread inside run().
    bool isCurrent() const { return _runner.load() == std::this_thread::get_id(); }

private:
    Source _wrap(int result, sd_event_source* source, std::unique_ptr<std::function<void()>> handler);
    void _runPosted() STW_EXCLUDES(_lock);

    sd_event* _event = nullptr;
    STWFileDescriptor _wakeFD; // an eventfd that post() writes
    Source _wakeSource;
    std::atomic<std::thread::id> _runner{};
    // Touched only by the thread in run() (or its owner while no thread is).
    bool _exitRequested = false;
    int _exitCode = 0;

    STWMutex _lock;
    std::vector<std::function<void()>> _lock_posted STW_GUARDED_BY(_lock);
};

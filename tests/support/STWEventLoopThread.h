// Runs the process's event loop (STWEventLoop::main()) on a thread of its own for the life
// of the object, as the daemon's main thread does, for tests of what the loop dispatches
// (file watches). Events that arrive before it starts wait for it.
#pragma once

#include "platform/STWEventLoop.h"

#include <thread>

class STWEventLoopThread {
public:
    STWEventLoopThread() : _thread([] { STWEventLoop::main().run(); }) {}
    ~STWEventLoopThread() {
        STWEventLoop::main().post([] { STWEventLoop::main().exit(0); });
        _thread.join();
    }
    STWEventLoopThread(const STWEventLoopThread&) = delete;
    STWEventLoopThread& operator=(const STWEventLoopThread&) = delete;

private:
    std::thread _thread;
};

#include "platform/STWEventLoop.h"

#include "common/STWLog.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/signalfd.h>
#include <systemd/sd-event.h>
#include <unistd.h>

namespace {

// How late a timer may fire, so that sd-event can wake once for timers that are due
// close together. Nothing the daemon times needs better.
constexpr uint64_t kTimerAccuracyMicroseconds = 1000;

int dispatch(void* userdata) {
    auto* handler = static_cast<std::function<void()>*>(userdata);
    try {
        (*handler)();
    } catch (const std::exception& e) {
        STW_FATAL("uncaught exception on the event loop: %s", e.what());
    } catch (...) {
        STW_FATAL("uncaught exception on the event loop");
    }
    // A negative answer would turn the source off for good.
    return 0;
}

int onIO(sd_event_source*, int, uint32_t, void* userdata) {
    return dispatch(userdata);
}
int onSignal(sd_event_source*, const struct signalfd_siginfo*, void* userdata) {
    return dispatch(userdata);
}
int onTime(sd_event_source*, uint64_t, void* userdata) {
    return dispatch(userdata);
}

} // namespace

STWEventLoop::Source::Source(Source&& other) noexcept
    : _source(std::exchange(other._source, nullptr)), _handler(std::move(other._handler)) {}

STWEventLoop::Source& STWEventLoop::Source::operator=(Source&& other) noexcept {
    if (this != &other) {
        reset();
        _source = std::exchange(other._source, nullptr);
        _handler = std::move(other._handler);
    }
    return *this;
}

void STWEventLoop::Source::reset() {
    // The source goes first: sd-event may not call a handler that is gone.
    if (_source)
        sd_event_source_disable_unref(_source);
    _source = nullptr;
    _handler.reset();
}

void STWEventLoop::Source::setEnabled(bool enabled) {
    if (_source)
        sd_event_source_set_enabled(_source, enabled ? SD_EVENT_ON : SD_EVENT_OFF);
}

void STWEventLoop::Source::armAt(std::chrono::steady_clock::time_point when) {
    if (!_source)
        return;
    // steady_clock is CLOCK_MONOTONIC, the clock the timer was made on.
    auto usec = std::chrono::duration_cast<std::chrono::microseconds>(when.time_since_epoch()).count();
    sd_event_source_set_time(_source, static_cast<uint64_t>(std::max<int64_t>(usec, 1)));
    sd_event_source_set_enabled(_source, SD_EVENT_ONESHOT);
}

STWEventLoop& STWEventLoop::main() {
    static STWEventLoop* loop = new STWEventLoop; // queue threads may post to it up to exit
    return *loop;
}

STWEventLoop::STWEventLoop() {
    if (int r = sd_event_new(&_event); r < 0)
        STW_FATAL("Cannot create the event loop: %s", strerror(-r));
    _wakeFD.reset(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    if (!_wakeFD)
        STW_FATAL("Cannot create the event loop's eventfd: %s", strerror(errno));
    _wakeSource = watchReadable(_wakeFD.get(), [this] { _runPosted(); });
    if (!_wakeSource)
        STW_FATAL("Cannot watch the event loop's eventfd: %s", strerror(errno));
}

STWEventLoop::~STWEventLoop() {
    _wakeSource.reset();
    sd_event_unref(_event);
}

STWEventLoop::Source STWEventLoop::_wrap(int result, sd_event_source* source,
                                         std::unique_ptr<std::function<void()>> handler) {
    Source wrapped;
    if (result < 0) {
        errno = -result;
        return wrapped;
    }
    wrapped._source = source;
    wrapped._handler = std::move(handler);
    return wrapped;
}

STWEventLoop::Source STWEventLoop::watchReadable(int fd, std::function<void()> handler, bool edgeTriggered) {
    auto owned = std::make_unique<std::function<void()>>(std::move(handler));
    sd_event_source* source = nullptr;
    int r = sd_event_add_io(_event, &source, fd, EPOLLIN | (edgeTriggered ? EPOLLET : 0u), onIO, owned.get());
    return _wrap(r, source, std::move(owned));
}

STWEventLoop::Source STWEventLoop::watchSignal(int signal, std::function<void()> handler) {
    auto owned = std::make_unique<std::function<void()>>(std::move(handler));
    sd_event_source* source = nullptr;
    int r = sd_event_add_signal(_event, &source, signal, onSignal, owned.get());
    return _wrap(r, source, std::move(owned));
}

STWEventLoop::Source STWEventLoop::timer(std::function<void()> handler) {
    auto owned = std::make_unique<std::function<void()>>(std::move(handler));
    sd_event_source* source = nullptr;
    int r = sd_event_add_time(_event, &source, CLOCK_MONOTONIC, UINT64_MAX, kTimerAccuracyMicroseconds,
                              onTime, owned.get());
    Source wrapped = _wrap(r, source, std::move(owned));
    wrapped.disarm();
    return wrapped;
}

void STWEventLoop::post(std::function<void()> work) {
    bool wake;
    {
        STWLockGuard guard(_lock);
        // Only the first of a batch needs to wake the loop: it takes the whole batch.
        wake = _lock_posted.empty();
        _lock_posted.push_back(std::move(work));
    }
    uint64_t one = 1;
    if (wake && write(_wakeFD.get(), &one, sizeof one) != sizeof one)
        STW_LOG_ERROR(STWLogCategory::Unspecified, "Cannot wake the event loop: %s", strerror(errno));
}

void STWEventLoop::_runPosted() {
    // Drained before the batch is taken, so a post() that finds the batch empty after
    // this point wakes the loop again.
    uint64_t count;
    while (read(_wakeFD.get(), &count, sizeof count) < 0 && errno == EINTR) {
    }
    std::vector<std::function<void()>> batch;
    {
        STWLockGuard guard(_lock);
        batch.swap(_lock_posted);
    }
    for (auto& work : batch)
        work();
}

int STWEventLoop::run() {
    _runner = std::this_thread::get_id();
    _exitRequested = false;
    int failure = 0;
    while (!_exitRequested) {
        // One event per call: an exit() by its handler is seen before the next one.
        int r = sd_event_run(_event, UINT64_MAX);
        if (r < 0 && r != -EINTR) {
            failure = -r;
            STW_LOG_ERROR(STWLogCategory::Unspecified, "The event loop failed: %s", strerror(failure));
            break;
        }
    }
    _runner = std::thread::id();
    if (failure) {
        errno = failure;
        return -1;
    }
    return _exitCode;
}

void STWEventLoop::exit(int code) {
    _exitCode = code;
    _exitRequested = true;
}

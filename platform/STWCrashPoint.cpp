#include "platform/STWCrashPoint.h"
#include "common/STWThreadSafety.h"

#include "common/STWLog.h"

#include <algorithm>
#include <csignal>
#include <cstdlib>
#include <mutex>
#include <string>
#include <unistd.h>

namespace STWCrashPoint {

std::atomic<bool> armed{false};

namespace {

STWMutex stateLock;
std::string armedName STW_GUARDED_BY(stateLock);
uint64_t remainingPasses STW_GUARDED_BY(stateLock) = 0;
std::function<void(std::string_view)> testHandler STW_GUARDED_BY(stateLock);

} // namespace

void _reached(const char* name) {
    std::function<void(std::string_view)> handler;
    {
        STWLockGuard guard(stateLock);
        handler = testHandler;
        if (!handler && (armedName != name || --remainingPasses > 0))
            return;
    }
    if (handler) {
        handler(name);
        return;
    }
    STW_LOG_NOTICE(STWLogCategory::Unspecified, "Crash point %s reached: stopping as a power cut would", name);
    STWLog::flush();
    kill(getpid(), SIGKILL);
    _exit(137); // not reached
}

void armFromEnvironment(bool internalImage) {
    const char* value = getenv("STOWLY_CRASH_AT");
    if (!value || !*value)
        return;
    if (!internalImage) {
        STW_LOG_ERROR(STWLogCategory::Unspecified, "Ignoring STOWLY_CRASH_AT=%s: not an internal image", value);
        return;
    }
    std::string spec = value;
    uint64_t pass = 1;
    if (size_t colon = spec.find(':'); colon != std::string::npos) {
        pass = std::strtoull(spec.c_str() + colon + 1, nullptr, 10);
        spec.resize(colon);
    }
    if (pass == 0 || std::find(all.begin(), all.end(), spec) == all.end()) {
        STW_LOG_ERROR(STWLogCategory::Unspecified, "Ignoring STOWLY_CRASH_AT=%s: no such crash point", value);
        return;
    }
    STWLockGuard guard(stateLock);
    armedName = spec;
    remainingPasses = pass;
    armed = true;
    STW_LOG_NOTICE(STWLogCategory::Unspecified, "Crash point %s armed for pass %llu", spec, pass);
}

void setHandlerForTesting(std::function<void(std::string_view name)> handler) {
    STWLockGuard guard(stateLock);
    testHandler = std::move(handler);
    armed = testHandler != nullptr || !armedName.empty();
}

} // namespace STWCrashPoint

// Fault injection: the named points of the file layer's disk-changing calls, armed by tests.
#include "Daemon/FileSystem/STWFaultInjection.h"

#include "common/STWLog.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace {

constexpr size_t kPointCount = static_cast<size_t>(STWFaultPoint::Count);

constexpr std::array<const char*, kPointCount> kPointNames = {
    "mkdirat",   // MakeDirectory
    "create",    // Create
    "write",     // Write
    "fsync",     // Sync
    "renameat2", // Rename
    "fchown",    // ChangeOwner
    "fchmod",    // ChangeMode
    "setxattr",  // SetAttribute
    "setflags",  // SetFlags
    "unlinkat",  // Remove
};

struct Fault {
    unsigned nth = 0; // 0: not armed
    unsigned calls = 0;
    int error = 0;
};

using Entry = std::pair<STWFaultPoint, Fault>;

struct State {
    // Guards everything below. Taken only on the way through an armed point.
    std::mutex mutex;
    std::array<Fault, kPointCount> faults;
};

State& state() {
    // Never destroyed: a point may be passed while the process exits.
    static State* shared = new State;
    return *shared;
}

size_t indexOf(STWFaultPoint point) {
    return static_cast<size_t>(point);
}

std::optional<unsigned> positiveNumber(std::string_view text) {
    unsigned value = 0;
    auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value);
    if (ec != std::errc() || end != text.data() + text.size() || value == 0)
        return std::nullopt;
    return value;
}

std::optional<Entry> makeEntry(std::string_view name, unsigned nth, unsigned error) {
    for (size_t i = 0; i < kPointCount; ++i) {
        if (name == kPointNames[i] && nth > 0 && error > 0 && error <= INT_MAX)
            return Entry{static_cast<STWFaultPoint>(i), Fault{nth, 0, static_cast<int>(error)}};
    }
    return std::nullopt;
}

// "POINT:N:ERRNO[,POINT:N:ERRNO...]"; nullopt when any entry is malformed.
std::optional<std::vector<Entry>> parseList(std::string_view list) {
    std::vector<Entry> entries;
    for (size_t start = 0; start <= list.size();) {
        size_t end = std::min(list.find(',', start), list.size());
        std::string_view text = list.substr(start, end - start);
        start = end + 1;
        size_t first = text.find(':');
        size_t second = first == std::string_view::npos ? first : text.find(':', first + 1);
        std::optional<Entry> entry;
        if (second != std::string_view::npos) {
            auto nth = positiveNumber(text.substr(first + 1, second - first - 1));
            auto error = positiveNumber(text.substr(second + 1));
            if (nth && error)
                entry = makeEntry(text.substr(0, first), *nth, *error);
        }
        if (!entry) {
            STW_LOG_ERROR(STWLogCategory::FS, "Malformed fault %s in %s (want POINT:N:ERRNO)",
                          std::string(text), std::string(list));
            return std::nullopt;
        }
        entries.push_back(*entry);
    }
    return entries;
}

void install(State& s, const std::vector<Entry>& entries) {
    for (const Entry& entry : entries)
        s.faults[indexOf(entry.first)] = entry.second;
}

} // namespace

constinit std::atomic<bool> STWFaultInjection::_armed{false};

void STWFaultInjection::armFromEnvironment(bool internalImage) {
    const char* list = getenv(environmentVariable);
    if (!list || !*list)
        return;
    if (!internalImage) {
        STW_LOG_ERROR(STWLogCategory::FS, "Ignoring %s=%s: not an internal image", environmentVariable, list);
        return;
    }
    if (!armFromList(list)) {
        STW_LOG_ERROR(STWLogCategory::FS, "Ignoring %s=%s: malformed", environmentVariable, list);
        return;
    }
    STW_LOG_NOTICE(STWLogCategory::FS, "Fault injection armed from %s=%s", environmentVariable, list);
}

bool STWFaultInjection::arm(std::string_view name, unsigned nth, int error) {
    std::optional<Entry> entry = makeEntry(name, nth, error > 0 ? static_cast<unsigned>(error) : 0);
    if (!entry)
        return false;
    State& s = state();
    std::lock_guard guard(s.mutex);
    install(s, {*entry});
    _armed.store(true, std::memory_order_release);
    return true;
}

bool STWFaultInjection::armFromList(std::string_view list) {
    std::optional<std::vector<Entry>> entries = parseList(list);
    if (!entries)
        return false;
    State& s = state();
    std::lock_guard guard(s.mutex);
    install(s, *entries);
    _armed.store(true, std::memory_order_release);
    return true;
}

void STWFaultInjection::disarm() {
    State& s = state();
    std::lock_guard guard(s.mutex);
    s.faults = {};
    _armed.store(false, std::memory_order_release);
}

int STWFaultInjection::_fire(STWFaultPoint point) {
    State& s = state();
    unsigned call = 0;
    int error = 0;
    {
        std::lock_guard guard(s.mutex);
        Fault& fault = s.faults[indexOf(point)];
        if (fault.nth != 0 && ++fault.calls == fault.nth) {
            call = fault.calls;
            error = fault.error;
            fault = {};
        }
        bool anyArmed = false;
        for (const Fault& armed : s.faults)
            anyArmed = anyArmed || armed.nth != 0;
        _armed.store(anyArmed, std::memory_order_release);
    }
    if (error)
        STW_LOG_NOTICE(STWLogCategory::FS, "Injected fault: call %u through %s fails with %s", call,
                       kPointNames[indexOf(point)], strerror(error));
    return error;
}

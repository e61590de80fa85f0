#include "common/STWIPCFrameBudget.h"

#include "common/STWLog.h"

bool STWIPCFrameBudget::reserve(size_t bytes) {
    size_t reserved = _reserved.load();
    do {
        if (bytes > _limit - reserved)
            return false;
    } while (!_reserved.compare_exchange_weak(reserved, reserved + bytes));
    return true;
}

void STWIPCFrameBudget::release(size_t bytes) {
    size_t before = _reserved.fetch_sub(bytes);
    if (before < bytes)
        STW_LOG_FAULT(STWLogCategory::Tolvan, "Frame budget released %zu bytes more than were reserved",
                      bytes - before);
}

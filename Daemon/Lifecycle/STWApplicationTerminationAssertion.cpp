#include "Daemon/Lifecycle/STWApplicationTerminationAssertion.h"

#include "common/STWLog.h"

#include <semaphore>

std::shared_ptr<STWApplicationTerminationAssertion>
STWApplicationTerminationAssertion::initWithBundleIdentifier(const std::string& bundleIdentifier,
                                                             int32_t reason) {
    auto result = std::make_shared<STWApplicationTerminationAssertion>();
    auto service = STWApplicationTerminationService::sharedInstance();
    if (!service->isAvailable()) {
        STW_LOG_ERROR(STWLogCategory::Lifecycle, "Application termination assertions are unavailable at %@",
                      service->recordDirectory());
        return result;
    }
    if (reason < -1 || reason > 1)
        STW_FATAL("Unknown reason: %d", reason);

    // The service may answer on a thread of its own; `failed` is read only once it has.
    std::binary_semaphore completion(0);
    bool failed = false;
    result->setTermAssertion(
        service->acquireAssertion(bundleIdentifier, reason, [&](const STWErrorRef& error) {
            if (error) {
                STW_LOG_ERROR(STWLogCategory::Lifecycle,
                              "Failed to acquire termination assertion for %@ : %@", bundleIdentifier, error);
                failed = true;
            }
            completion.release();
        }));
    completion.acquire();
    if (failed) {
        result->invalidate();
        result->setTermAssertion(nullptr);
        return nullptr;
    }
    return result;
}

STWApplicationTerminationAssertion::~STWApplicationTerminationAssertion() {
    invalidate();
}

void STWApplicationTerminationAssertion::invalidate() {
    if (_termAssertion)
        _termAssertion->invalidate();
}

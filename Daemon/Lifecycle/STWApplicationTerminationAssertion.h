// Stops an application while the daemon changes its files: the data-protection
// change takes one for a container's identifier before it rewrites the container and
// invalidates it when done. Holds one assertion of the application-termination service
// (platform/STWApplicationTerminationService.h says what that does on Linux).
//
// Acquisition blocks its caller until the service has answered. Not thread-safe: its owner
// uses it from one queue at a time.
#pragma once

#include "platform/STWApplicationTerminationService.h"

#include <cstdint>
#include <memory>
#include <string>

class STWApplicationTerminationAssertion {
public:
    using TermAssertionRef = std::shared_ptr<STWApplicationTerminationService::Assertion>;

    // Terminates the application `bundleIdentifier` for `reason` (-1, 0 or 1; any other
    // value stops the daemon) and holds the termination until invalidated. nullptr when
    // the assertion could not be acquired. When the service is unavailable, an object that
    // holds nothing (a null termAssertion()).
    static std::shared_ptr<STWApplicationTerminationAssertion>
    initWithBundleIdentifier(const std::string& bundleIdentifier, int32_t reason);

    STWApplicationTerminationAssertion() = default;
    ~STWApplicationTerminationAssertion();
    STWApplicationTerminationAssertion(const STWApplicationTerminationAssertion&) = delete;
    STWApplicationTerminationAssertion& operator=(const STWApplicationTerminationAssertion&) = delete;

    // Ends the hold; the application may run again once no other assertion holds it.
    void invalidate();

    const TermAssertionRef& termAssertion() const { return _termAssertion; }
    void setTermAssertion(TermAssertionRef termAssertion) { _termAssertion = std::move(termAssertion); }

private:
    TermAssertionRef _termAssertion;
};

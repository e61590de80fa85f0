// The stand-in for the platform's application-termination service: an assertion on a bundle
// identifier stops that application and records that it is to stay stopped until the
// assertion is invalidated. The data-protection change holds one (through
// STWApplicationTerminationAssertion) while it rewrites an application's container.
//
// An application is whatever the client registry lists under its code-signing identifier.
// Acquiring an assertion:
//   1. records the hold as the file ROOT/run/stowly/terminated/NAME, where NAME is the
//      identifier escaped as the sandbox mapping store escapes its names
//      (STWSandboxMappingStore::nameForIdentifier), so no identifier climbs out of the
//      directory; holds of one identifier share the record, which goes with the last;
//   2. kills with SIGKILL every process whose executable (/proc/PID/exe) is one of the
//      registered files, by device and inode, so a copy of the program elsewhere is left
//      alone. Each process is pinned by a pidfd before its executable is looked at and is
//      signalled through it, so a pid recycled meanwhile is never hit.
//
// What Linux does not give us: there is no hook into process launch, so the application is
// killed when an assertion is acquired and not again; it can be started while the record
// exists. The record is for whoever launches applications to honour; nothing enforces it.
// A record left by a daemon that died holding an assertion stays until the runtime
// directory is cleared (a reboot).
//
// Thread-safe: assertions may be acquired and invalidated from any thread; the count of
// holds per identifier is kept under `_holdsLock`, and the record is written and removed
// under it, so a record exists exactly while some assertion on its identifier is held.
#pragma once

#include "common/STWError.h"
#include "common/STWThreadSafety.h"
#include "platform/STWClientRegistry.h"

#include <atomic>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

class STWApplicationTerminationService
    : public std::enable_shared_from_this<STWApplicationTerminationService> {
public:
    // Called once with the outcome of an acquisition: nullptr when the assertion is held.
    using AcquisitionHandler = std::function<void(const STWErrorRef& error)>;

    // One hold on an application. Invalidated by invalidate() or on destruction, whichever
    // comes first; invalidating an assertion that holds nothing does nothing.
    class Assertion {
    public:
        Assertion(std::shared_ptr<STWApplicationTerminationService> service, std::string bundleIdentifier,
                  int32_t reason);
        ~Assertion();
        Assertion(const Assertion&) = delete;
        Assertion& operator=(const Assertion&) = delete;

        void invalidate();
        const std::string& bundleIdentifier() const { return _bundleIdentifier; }
        int32_t reason() const { return _reason; }

    private:
        friend class STWApplicationTerminationService;
        const std::shared_ptr<STWApplicationTerminationService> _service;
        const std::string _bundleIdentifier;
        const int32_t _reason;
        std::atomic<bool> _held{false};
    };

    // The service of the configured root prefix, over the shared client registry.
    static std::shared_ptr<STWApplicationTerminationService> sharedInstance();

    STWApplicationTerminationService(std::filesystem::path recordDirectory, STWClientRegistry& registry);

    // Whether assertions can be held: the record directory is there or can be made.
    bool isAvailable();

    // A new assertion on `bundleIdentifier` for `reason` (-1, 0 or 1; only logged here).
    // `handler` gets the outcome before this returns; callers still wait for it rather than
    // rely on that. An identifier the registry does not know, a record that cannot be
    // written, or a process that cannot be signalled fail the acquisition. After a failure
    // the assertion may still hold the record: invalidate it.
    std::shared_ptr<Assertion> acquireAssertion(const std::string& bundleIdentifier, int32_t reason,
                                                const AcquisitionHandler& handler);

    const std::filesystem::path& recordDirectory() const { return _recordDirectory; }

private:
    STWErrorRef _acquire(Assertion& assertion);
    void _release(const std::string& bundleIdentifier);
    // Sends SIGKILL to every process running one of `executables`.
    STWErrorRef _killProcessesRunning(const std::vector<std::filesystem::path>& executables,
                                      const Assertion& assertion);

    const std::filesystem::path _recordDirectory;
    STWClientRegistry& _registry;
    STWMutex _holdsLock;
    // Record name to the number of assertions holding it.
    std::map<std::string, uint64_t> _holdsLock_holds STW_GUARDED_BY(_holdsLock);
};

#include "platform/STWApplicationTerminationService.h"

#include "common/STWFileDescriptor.h"
#include "common/STWFileIO.h"
#include "common/STWLog.h"
#include "platform/STWPlatformConfiguration.h"
#include "platform/STWSandboxMappingStore.h"

#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <set>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>
#include <utility>

STWApplicationTerminationService::Assertion::Assertion(
    std::shared_ptr<STWApplicationTerminationService> service, std::string bundleIdentifier, int32_t reason)
    : _service(std::move(service)), _bundleIdentifier(std::move(bundleIdentifier)), _reason(reason) {}

STWApplicationTerminationService::Assertion::~Assertion() {
    invalidate();
}

void STWApplicationTerminationService::Assertion::invalidate() {
    if (_held.exchange(false))
        _service->_release(_bundleIdentifier);
}

std::shared_ptr<STWApplicationTerminationService> STWApplicationTerminationService::sharedInstance() {
    static const auto service = std::make_shared<STWApplicationTerminationService>(
        STWPlatformConfiguration::sharedInstance()->runtimeDirectory() / "terminated",
        STWClientRegistry::sharedInstance());
    return service;
}

STWApplicationTerminationService::STWApplicationTerminationService(std::filesystem::path recordDirectory,
                                                                   STWClientRegistry& registry)
    : _recordDirectory(std::move(recordDirectory)), _registry(registry) {}

bool STWApplicationTerminationService::isAvailable() {
    std::error_code ec;
    std::filesystem::create_directories(_recordDirectory, ec);
    return std::filesystem::is_directory(_recordDirectory, ec);
}

std::shared_ptr<STWApplicationTerminationService::Assertion>
STWApplicationTerminationService::acquireAssertion(const std::string& bundleIdentifier, int32_t reason,
                                                   const AcquisitionHandler& handler) {
    auto assertion = std::make_shared<Assertion>(shared_from_this(), bundleIdentifier, reason);
    handler(_acquire(*assertion));
    return assertion;
}

STWErrorRef STWApplicationTerminationService::_acquire(Assertion& assertion) {
    const std::string& identifier = assertion._bundleIdentifier;
    std::vector<std::filesystem::path> executables =
        _registry.executablesForCodeSigningIdentifier(identifier);
    if (executables.empty())
        return STW_POSIX_ERROR_NOLOG(ENOENT, "No application is registered as %@", identifier);

    // Recorded before the first kill, so that a launcher honouring the record cannot start
    // the application again between the kill and the record.
    std::string name = STWSandboxMappingStore::nameForIdentifier(identifier);
    {
        STWLockGuard guard(_holdsLock);
        uint64_t& holds = _holdsLock_holds[name];
        if (holds == 0) {
            if (int e = STWWriteFile(_recordDirectory / name, "", 0644, false)) {
                _holdsLock_holds.erase(name);
                return STW_POSIX_ERROR_NOLOG(e, "Cannot record the termination of %@ at %@", identifier,
                                             _recordDirectory / name);
            }
        }
        ++holds;
        assertion._held = true;
    }
    return _killProcessesRunning(executables, assertion);
}

void STWApplicationTerminationService::_release(const std::string& bundleIdentifier) {
    std::string name = STWSandboxMappingStore::nameForIdentifier(bundleIdentifier);
    STWLockGuard guard(_holdsLock);
    auto it = _holdsLock_holds.find(name);
    if (it == _holdsLock_holds.end() || --it->second > 0)
        return;
    _holdsLock_holds.erase(it);
    if (unlink((_recordDirectory / name).c_str()) != 0 && errno != ENOENT)
        STW_LOG_ERROR(STWLogCategory::Lifecycle, "Cannot remove the termination record %@: %s",
                      _recordDirectory / name, strerror(errno));
}

STWErrorRef
STWApplicationTerminationService::_killProcessesRunning(const std::vector<std::filesystem::path>& executables,
                                                        const Assertion& assertion) {
    std::set<std::pair<dev_t, ino_t>> files;
    for (const std::filesystem::path& executable : executables) {
        struct stat st;
        if (stat(executable.c_str(), &st) == 0)
            files.emplace(st.st_dev, st.st_ino);
    }
    // A program that is not installed has no process to kill.
    if (files.empty())
        return nullptr;

    std::error_code ec;
    std::filesystem::directory_iterator proc("/proc", ec);
    if (ec)
        return STW_POSIX_ERROR_NOLOG(ec.value(), "Cannot list processes");
    STWErrorRef failure;
    for (std::filesystem::directory_iterator end; proc != end; proc.increment(ec)) {
        std::string name = proc->path().filename();
        char* rest = nullptr;
        long pid = strtol(name.c_str(), &rest, 10);
        // The daemon never terminates itself, whatever the registry says.
        if (*rest != '\0' || pid <= 0 || pid == getpid())
            continue;
        // Pinned first: should the process exit and its pid be reused before the signal,
        // the signal goes to the dead process (ESRCH) and never to the newcomer.
        STWFileDescriptor pidfd(static_cast<int>(syscall(SYS_pidfd_open, static_cast<pid_t>(pid), 0)));
        if (!pidfd) {
            if (errno == ESRCH)
                continue;
            return STW_POSIX_ERROR_NOLOG(errno, "Cannot open a pidfd for process %d", pid);
        }
        // Kernel threads and processes that already exited have no executable.
        struct stat st;
        std::string exe = "/proc/" + std::to_string(pid) + "/exe";
        if (stat(exe.c_str(), &st) != 0 || !files.count({st.st_dev, st.st_ino}))
            continue;
        if (syscall(SYS_pidfd_send_signal, pidfd.get(), SIGKILL, nullptr, 0) != 0) {
            if (errno != ESRCH)
                failure = STW_POSIX_ERROR_NOLOG(errno, "Cannot kill process %d of %@", pid,
                                                assertion.bundleIdentifier());
            continue;
        }
        STW_LOG_NOTICE(STWLogCategory::Lifecycle, "Killed process %d of %@ (termination reason %d)", pid,
                       assertion.bundleIdentifier(), assertion.reason());
    }
    if (ec)
        return STW_POSIX_ERROR_NOLOG(ec.value(), "Cannot list processes");
    return failure;
}

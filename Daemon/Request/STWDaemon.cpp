#include "Daemon/Request/STWDaemon.h"

#include "Daemon/FileSystem/STWFaultInjection.h"
#include "Daemon/Lifecycle/STWDaemonQueues.h"
#include "Daemon/Lifecycle/STWTestLocks.h"
#include "Daemon/Migration/STWContainerMigrator.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Request/STWClientConnection.h"
#include "Daemon/Request/STWRequestDispatcher.h"
#include "common/STWLog.h"
#include "platform/STWCrashPoint.h"
#include "platform/STWEventLoop.h"
#include "platform/STWIPCListener.h"
#include "platform/STWIdleExitTimer.h"
#include "platform/STWKeybag.h"
#include "platform/STWPlatformConfiguration.h"
#include "platform/STWSandboxExtension.h"
#include "platform/STWTransaction.h"
#include "upcall/STWKernServer.h"

#include <CLI/CLI.hpp>
#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <malloc.h>
#include <mutex>
#include <semaphore.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>
#include <vector>

namespace {

std::once_flag onceInitializationToken;
std::once_flag upcallServerToken;
std::atomic<bool> initialisationFinishedFlag{false};
// Written only by the lock-state callback, on the main thread; read by anyone.
std::atomic<int> lockState{3};
bool firstBoot = false;

void signpost(const char* interval, bool begin) {
    STW_LOG_DEBUG(STWLogCategory::Tolvan, "%s %s", begin ? "begin" : "end", interval);
}

// A system notification: a marker file beside the socket, and a status line for the
// service manager. Answers 0 or an errno value.
uint32_t postNotification(const char* name) {
    auto file = STWPlatformConfiguration::sharedInstance()->runtimeDirectory() / name;
    int fd = open(file.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0)
        return static_cast<uint32_t>(errno);
    close(fd);
    sd_notifyf(0, "STATUS=%s", name);
    return 0;
}

// The marker of a cleanup that is about to run again: a waiter must not take the one an
// earlier start left for its own run.
void withdrawNotification(const char* name) {
    auto file = STWPlatformConfiguration::sharedInstance()->runtimeDirectory() / name;
    if (unlink(file.c_str()) != 0 && errno != ENOENT)
        STW_LOG_ERROR(STWLogCategory::Startup, "Failed to withdraw %s: %s", name, strerror(errno));
}

void firstBootCompletion() {
    STW_LOG_NOTICE(STWLogCategory::Startup, "stowlyd first boot cleanup complete");
    std::string name = STWPlatformConfiguration::sharedInstance()->firstBootSemaphoreName();
    sem_t* semaphore = sem_open(name.c_str(), O_CREAT, 0444, 0);
    if (semaphore == SEM_FAILED)
        STW_LOG_ERROR(STWLogCategory::Startup, "Failed to create semaphore %s: %s", name, strerror(errno));
    else
        sem_close(semaphore);
    if (uint32_t status = postNotification("reboot-cleanup-complete"))
        STW_LOG_ERROR(STWLogCategory::Startup, "Failed to post reboot-cleanup-complete: %u", status);
    signpost("FirstBootCleanup", false);
}

// The listener derives its connection caps from the descriptor limit: take all the
// system allows.
void raiseDescriptorLimit() {
    rlimit limit{};
    if (getrlimit(RLIMIT_NOFILE, &limit) != 0)
        return;
    rlim_t before = limit.rlim_cur;
    limit.rlim_cur = limit.rlim_max;
    if (before == limit.rlim_max)
        STW_LOG_NOTICE(STWLogCategory::Startup, "Descriptor limit: %llu",
                       static_cast<unsigned long long>(before));
    else if (setrlimit(RLIMIT_NOFILE, &limit) != 0)
        STW_LOG_ERROR(STWLogCategory::Startup, "Cannot raise the descriptor limit from %llu: %s",
                      static_cast<unsigned long long>(before), strerror(errno));
    else
        STW_LOG_NOTICE(STWLogCategory::Startup, "Raised the descriptor limit from %llu to %llu",
                       static_cast<unsigned long long>(before),
                       static_cast<unsigned long long>(limit.rlim_max));
}

// glibc raises its mmap threshold to the size of every mapped block that is freed, up to
// 32 MiB; after one large frame, the next ones come from the heap and their memory stays
// with the process when they are freed. A fixed threshold keeps every block of 128 KiB
// or more (frame buffers, large decoded values) mapped, so freeing it returns it.
void fixMallocThresholds() {
    if (mallopt(M_MMAP_THRESHOLD, 128 * 1024) != 1)
        STW_LOG_ERROR(STWLogCategory::Startup, "Cannot fix the mmap threshold of malloc");
}

void cleanupCompletion(uint64_t) {
    // The pass's own failures were logged where they happened.
    if (uint32_t status = postNotification("cleanup-complete"))
        STW_LOG_ERROR(STWLogCategory::Startup, "Failed to post cleanup-complete: %u", status);
    signpost("BootCleanup", false);
}

} // namespace


bool STWDaemon::initialisationFinished() { return initialisationFinishedFlag.load(); }

int STWDaemon::storedLockState() { return lockState.load(); }

void STWDaemon::keybag_notification_callback() {
    int state = STWKeybag::lockState();
    STW_LOG_DEBUG(STWLogCategory::Unspecified, "LockState=%d", state);
    if (state == STWKeybagLocked) {
        if (lockState.exchange(STWKeybagLocked) != STWKeybagLocked)
            STWDaemonQueues::lockState()->suspend();
    } else if (state == STWKeybagUnlocked) {
        // The stored state starts "unknown", so the first unlocked report resumes nothing.
        if (lockState.exchange(STWKeybagUnlocked) == STWKeybagLocked)
            STWDaemonQueues::lockState()->resume();
    }
}

void STWDaemon::_onceInitialization() {
    signpost("StartingUp", true);
    auto globalConfiguration = STWGlobalConfiguration::sharedInstance();
    std::filesystem::path logFile = globalConfiguration->logDirectory() / "stowlyd.log";
    STWLog::openLogFile(logFile, "com.vorlane.stowlyd", STWLogLevel::Notice);
    bool internal = globalConfiguration->isInternalImage();
    STWLog::enableFileWriting(globalConfiguration->diskLogLevel(), internal ? 262144 : 102400);
    STW_LOG_FN("stowlyd_init", STWLogLevel::Debug, STWLogCategory::Startup, "stowlyd built at %s %s started", __DATE__,
               __TIME__);

    if (!STWDaemonQueues::deathRow() || !STWDaemonQueues::lockState())
        STW_FATAL("Can't create dispatch queues.");
    const auto& connection = STWClientConnection::sharedClientConnection();
    STWContainerMigrator::installBuildUpgrade();

    std::string semaphoreName = STWPlatformConfiguration::sharedInstance()->firstBootSemaphoreName();
    sem_t* semaphore = sem_open(semaphoreName.c_str(), 0);
    withdrawNotification("cleanup-complete");
    if (semaphore != SEM_FAILED) {
        sem_close(semaphore);
    } else {
        firstBoot = true;
        withdrawNotification("reboot-cleanup-complete");
        STW_LOG_NOTICE(STWLogCategory::Startup, "stowlyd performing first boot initialization");
        signpost("FirstBootSetup", true);
        connection->rebootStowlySetup();
        signpost("FirstBootSetup", false);
    }
    signpost("BootSetup", true);
    connection->stowlySetup();
    signpost("BootSetup", false);
    STWContainerMigrator::logRecordedMigrations();

    bool upcallServerStarted = false;
    std::call_once(upcallServerToken, [&] { upcallServerStarted = STWKernServerStart(); });
    if (!upcallServerStarted)
        STW_FATAL("Failed to initialize kernel upcall interface.");

    // Notifications come on the event loop, which this thread runs once start-up is done:
    // the state read here and every change after it are applied by the one thread, in order.
    if (!STWKeybag::registerForLockStateNotifications(keybag_notification_callback))
        STW_LOG_ERROR(STWLogCategory::Startup, "Failed to register for %s: %d", "keybag lock status", errno);
    keybag_notification_callback();

    if (firstBoot) {
        signpost("FirstBootCleanup", true);
        connection->rebootStowlyCleanupWithCompletion(firstBootCompletion);
    }
    signpost("BootCleanup", true);
    connection->stowlyCleanupWithCompletion(cleanupCompletion);

    initialisationFinishedFlag = true;
    signpost("StartingUp", false);
    STWTransaction::end();
}

void STWDaemon::_runOnceInitialization() { std::call_once(onceInitializationToken, _onceInitialization); }

int STWDaemon::main(int argc, char** argv) {
    CLI::App app{"stowlyd: the container daemon"};
    std::string root = "/";
    double idleTimeout = -1;
    app.add_option("--root", root, "Root prefix under which every path of the daemon lives");
    app.add_option("--idle-timeout", idleTimeout,
                   "Exit after this many idle seconds (0: never; default 60 under socket activation, else never)");
    CLI11_PARSE(app, argc, argv);

    // Signals are taken by the event loop (a signalfd), so no thread may take them the usual
    // way; every thread started from here on inherits the mask.
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGTERM);
    sigaddset(&signals, SIGINT);
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);
    signal(SIGPIPE, SIG_IGN);
    fixMallocThresholds();
    raiseDescriptorLimit();

    STWErrorRef error;
    auto configuration = STWPlatformConfiguration::loadFromRoot(root, &error);
    if (!configuration) {
        fprintf(stderr, "stowlyd: %s\n", error->message().c_str());
        return 1;
    }
    STWPlatformConfiguration::setSharedInstance(configuration);
    STWCrashPoint::armFromEnvironment(configuration->isInternalImage());
    std::error_code ec;
    std::filesystem::create_directories(configuration->runtimeDirectory(), ec);
    chmod(configuration->runtimeDirectory().c_str(), 0755);
    // A fresh key per start: tokens of an earlier run stop verifying.
    STWErrorRef keyError;
    if (!STWSandboxExtension::createKey(STWSandboxExtension::keyFile(), &keyError))
        STW_LOG_ERROR(STWLogCategory::Sandbox, "Cannot create the sandbox extension key: %@", keyError);
    if (configuration->isDeveloperMode())
        STW_LOG_FAULT(STWLogCategory::Startup,
                      "Developer mode is on: clients may declare any identity (root prefix %@)",
                      configuration->rootPrefix());

    STWTransaction::begin(); // ended by the once-initialisation
    // The main thread runs the event loop once start-up is done; until then connections
    // wait in the socket's backlog.
    STWEventLoop& loop = STWEventLoop::main();
    std::optional<STWIdleExitTimer> idleExit;
    STWIPCListener listener(
        {.socketPath = configuration->runtimeDirectory() / "stowlyd.sock",
         .developerMode = configuration->isDeveloperMode(),
         .allowSocketActivation = true,
         .bounds = configuration->clientBounds(),
         .connectionsClosed =
             [&idleExit] {
                 if (idleExit)
                     idleExit->review();
             }},
        [](const std::shared_ptr<STWPeerConnection>&) {
            _runOnceInitialization();
            if (!initialisationFinished())
                STW_LOG_FAULT(STWLogCategory::Unspecified, "Early Tolvan processing detected.");
        },
        [](const std::shared_ptr<STWPeerConnection>& peer, uint64_t requestID, STWValue::Dictionary request) {
            STWTransaction::Scope transaction;
            STWRequestDispatcher::processTolvanEvent(peer, requestID, request);
        });
    bool listening = listener.start(loop, &error);
    if (!listening)
        STW_LOG_FN("main", STWLogLevel::Error, STWLogCategory::Tolvan, "unable to start tolvan service!");

    _runOnceInitialization();
    // Faults a test asked for count from here, where requests are served.
    STWFaultInjection::armFromEnvironment(configuration->isInternalImage());
    sd_notify(0, "READY=1");
    STW_LOG_NOTICE(STWLogCategory::Startup, "stowlyd is serving root %@", configuration->rootPrefix());

    if (idleTimeout < 0)
        idleTimeout = listener.isSocketActivated() ? 60 : 0;
    if (idleTimeout > 0)
        idleExit.emplace(loop,
                         std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                             std::chrono::duration<double>(idleTimeout)),
                         listener);
    std::vector<STWEventLoop::Source> signalSources;
    for (int signalNumber : {SIGTERM, SIGINT}) {
        signalSources.push_back(loop.watchSignal(signalNumber, [&loop, signalNumber] {
            STW_LOG_FN("main", STWLogLevel::Notice, STWLogCategory::Startup, "Stopping on signal %d",
                       signalNumber);
            loop.exit(0);
        }));
        if (!signalSources.back())
            STW_FATAL("Cannot take signal %d on the event loop: %s", signalNumber, strerror(errno));
    }
    // A loop that failed (it says why) ends the daemon too, as a failure.
    int status = loop.run() < 0 ? 1 : 0;

    sd_notify(0, "STOPPING=1");
    // Requests in flight and work already posted (deletion passes, cleanups) get one
    // bound between them to finish.
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    // A request parked behind a test lock would wait for a release no client can send now.
    if (configuration->isInternalImage())
        STWTestLocks::sharedInstance()->releaseAllLocks();
    bool upcallsEnded = STWKernServerStop(deadline - std::chrono::steady_clock::now());
    bool connectionsEnded = listener.stop(deadline - std::chrono::steady_clock::now()) && upcallsEnded;
    if (!connectionsEnded || !STWTransaction::waitForIdle(deadline - std::chrono::steady_clock::now())) {
        // Whatever still runs uses objects that returning from main would destroy: leave
        // without running destructors. Everything on disk is crash-safe.
        STW_LOG_ERROR(STWLogCategory::Startup, "Exiting with %s still running",
                      connectionsEnded ? "posted work" : "connections");
        STWLog::flush();
        _exit(status);
    }
    STWLog::flush();
    return status;
}

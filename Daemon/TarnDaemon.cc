#include "Daemon/TarnDaemon.h"

#include <syslog.h>

#include <atomic>
#include <cstring>
#include <mutex>
#include <system_error>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnExceptionFence.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnKernServer.h"
#include "Daemon/TarnLog.h"
#include "Platform/ContainerLibrary.h"
#include "Platform/Failpoints.h"
#include "Platform/FirstBootMarker.h"
#include "Platform/HostConfiguration.h"
#include "Platform/LockState.h"
#include "Platform/Notifications.h"
#include "Platform/Path.h"
#include "Platform/PlatformLog.h"

namespace tarn {

namespace {

constexpr const char* kInitTag = "tarnkeeperd_init";

DispatchQueueRef gDeathRowQueue;
DispatchQueueRef gLockStateQueue;
std::once_flag gQueuesOnce;
std::atomic<uint32_t> gRotationCount{1};
uint32_t gSavedLockState = 3;  // touched only on the main queue (and once at start-up)
std::mutex gLockStateMu;       // start-up's direct call may overlap a main-queue delivery

void makeQueues() {
    std::call_once(gQueuesOnce, [] {
        gDeathRowQueue = DispatchQueue::createSerial("com.ostrea.tarnkeeperd.deathrow",
                                                     DispatchQueue::global(QoS::Background));
        gLockStateQueue = DispatchQueue::createSerial("com.ostrea.tarnkeeperd.lockstate");
    });
    if (!gDeathRowQueue || !gLockStateQueue) {
        PlatformLogWrite("daemon", PlatformLogType::Fault, "Can't create dispatch queues.");
        std::abort();
    }
}

// Both completions may run on background threads; intervals are objects here.
std::unique_ptr<SignpostInterval> gBootCleanupInterval;
std::unique_ptr<SignpostInterval> gFirstBootCleanupInterval;

void bootCleanupCompleted() {
    uint32_t status = NotifyPost(CONTAINER_NOTIFY_CLEANUP_COMPLETE);
    if (status != 0)
        PlatformLog("startup", PlatformLogType::Error, "Failed to post cleanup-complete: %u", status);
    gBootCleanupInterval.reset();
}

void firstBootCleanupCompleted() {
    TarnLog(kLogNotice, "set_first_boot_work_completed", "tarnkeeperd first boot cleanup complete");
    if (int err = FirstBootMarkerCreate(); err != 0) {
        TarnLog(kLogError, "set_first_boot_work_completed", "Failed to create semaphore %s: %s",
                FirstBootMarkerName(), std::strerror(err));
    }
    uint32_t status = NotifyPost(CONTAINER_NOTIFY_REBOOT_CLEANUP_COMPLETE);
    if (status != 0)
        PlatformLog("startup", PlatformLogType::Error, "Failed to post reboot-cleanup-complete: %u",
                    status);
    gFirstBootCleanupInterval.reset();
}

// Runs one start-up step at the exception fence: on internal builds a throw
// ends in the fatal report, elsewhere it is logged and start-up goes on (a
// half-done step is repaired by the next start, a missing listener is not).
template <class Step>
void runStartupStep(const char* name, Step&& step) {
    (void)TarnFenceExceptions(name, [&] {
        if (auto err = TARN_FAILPOINT("daemon.startup.step"))
            throw std::system_error(*err, std::generic_category(), name);
        step();
    });
}

}  // namespace

DispatchQueueRef TarnDeathRowQueue() {
    makeQueues();
    return gDeathRowQueue;
}

DispatchQueueRef TarnLockStateQueue() {
    makeQueues();
    return gLockStateQueue;
}

uint32_t TarnLogRotationCount() { return gRotationCount.load(); }

void TarnLockStateCallback() {
    std::lock_guard lock(gLockStateMu);
    int state = LockStateGet();
    TarnLog(kLogDebug, "lockstated_notification_callback", "LockState=%d", state);
    if (state == 1) {
        if (gSavedLockState != 1) TarnLockStateQueue()->suspend();
        gSavedLockState = 1;
    } else if (state == 0) {
        if (gSavedLockState == 1) TarnLockStateQueue()->resume();
        gSavedLockState = 0;
    }
}

uint32_t TEST_savedLockState() {
    std::lock_guard lock(gLockStateMu);
    return gSavedLockState;
}

void TEST_resetLockState() {
    std::lock_guard lock(gLockStateMu);
    if (gSavedLockState == 1) TarnLockStateQueue()->resume();
    gSavedLockState = 3;
}

void TarnDaemonStartupWork(const DispatchQueueRef& listenerQueue,
                           const std::function<void()>& onFinished) {
    SignpostInterval startingUp("conduit", "StartingUp");
    (void)TARN_FAILPOINT("daemon.startup");  // only ever stalls: tests of early requests
    auto& config = TarnGlobalConfiguration::sharedInstance();
    std::string logPath = PathJoin(config.logDirectory(), "tarnkeeperd.log");
    LogHandle* handle = LogOpen("com.ostrea.tarnkeeperd", kLogNotice);
    // The count is the build's, with or without a log: migrations keep that
    // many old files.
    gRotationCount = config.isInternalImage() ? 4 : 1;
    if (!handle) {
        ::syslog(LOG_ERR, "Failed to set up rotating logs at path %s", logPath.c_str());
    } else {
        TarnSetLogHandle(handle);
        uint64_t sizeLimit = config.isInternalImage() ? 262144 : 102400;
        if (LogEnableDiskLogging(handle, logPath, gRotationCount, sizeLimit) != 0)
            ::syslog(LOG_ERR, "Failed to set up rotating logs at path %s", logPath.c_str());
    }
    TarnLog(kLogDebug, kInitTag, "tarnkeeperd built at %s %s started", __DATE__, __TIME__);
    for (const auto& problem : HostConfiguration::shared().problems)
        TarnLog(kLogError, kInitTag, "Host configuration: %@", problem);
    makeQueues();

    TarnClientConnection& shared = TarnClientConnection::sharedClientConnection();
    bool firstLaunchSinceBoot = false;
    if (!FirstBootMarkerExists()) {
        TarnLog(kLogNotice, kInitTag, "tarnkeeperd performing first boot initialization");
        SignpostInterval firstBoot("startup", "FirstBootSetup");
        runStartupStep("rebootKeeperSetup", [&] { shared.rebootKeeperSetup(); });
        firstLaunchSinceBoot = true;
    }
    {
        SignpostInterval bootSetup("startup", "BootSetup");
        runStartupStep("keeperSetup", [&] { shared.keeperSetup(); });
    }
    if (!TarnKernServerStart(listenerQueue)) {
        PlatformLogWrite("daemon", PlatformLogType::Fault,
                         "Failed to initialize kernel upcall interface.");
        std::abort();
    }

    if (int status = LockStateRegister(TarnLockStateCallback); status != 0) {
        TarnLog(kLogError, kInitTag, "notify_register_dispatch for notification \"%s\" failed; returned %d\n",
                kLockStateNotification, status);
    }
    TarnLockStateCallback();

    if (firstLaunchSinceBoot) {
        gFirstBootCleanupInterval = std::make_unique<SignpostInterval>("startup", "FirstBootCleanup");
        runStartupStep("rebootKeeperCleanupWithCompletion", [&] {
            shared.rebootKeeperCleanupWithCompletion(firstBootCleanupCompleted);
        });
    }
    gBootCleanupInterval = std::make_unique<SignpostInterval>("startup", "BootCleanup");
    runStartupStep("keeperCleanupWithCompletion",
                   [&] { shared.keeperCleanupWithCompletion(bootCleanupCompleted); });
    startingUp.end();
    if (onFinished) onFinished();
}

}  // namespace tarn

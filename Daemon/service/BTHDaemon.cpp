#include "BTHDaemon.h"

#include "BTHFaultInjection.h"

#include <signal.h>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <syslog.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <optional>

#include "BTHApplicationTerminationAssertion.h"
#include "BTHAsyncWork.h"
#include "BTHClientConnection.h"
#include "BTHCodeSigningMapping.h"
#include "BTHError.h"
#include "BTHFirstBootSetup.h"
#include "BTHGlobalConfiguration.h"
#include "BTHGroupManager.h"
#include "BTHLockStateCallback.h"
#include "BTHLog.h"
#include "BTHRelayRequest.h"
#include "BTHUncaughtExceptionReporter.h"
#include "BTHUpcallServer.h"
#include "platform/CodeSigningRegistry.h"
#include "platform/DeviceProperties.h"
#include "platform/DeviceRoot.h"
#include "platform/LockStateNotification.h"
#include "platform/NamedSemaphore.h"
#include "platform/ProcessAttachPolicy.h"
#include "platform/RelayListener.h"
#include "platform/RelayTransaction.h"
#include "platform/RunLoop.h"
#include "platform/ServiceCheckIn.h"
#include "platform/ServiceManager.h"
#include "platform/UniqueFd.h"

namespace berth {

namespace {

// A positive count from the service's environment, else `fallback`.
size_t limitFromEnvironment(const char* name, size_t fallback) {
    BTH_FUNCTION("main");
    const char* text = std::getenv(name);
    if (!text) return fallback;
    char* end = nullptr;
    errno = 0;
    const unsigned long long value = std::strtoull(text, &end, 10);
    if (errno != 0 || end == text || *end != '\0' || value == 0 || text[0] == '-') {
        BTHLogError("Ignoring %s=%s: not a positive number; using %llu", name, text,
                    static_cast<unsigned long long>(fallback));
        return fallback;
    }
    return static_cast<size_t>(value);
}

// What one user other than root may hold on the request socket, as the
// service's configuration sets it.
RelayUserLimits userLimitsFromEnvironment() {
    RelayUserLimits limits;
    limits.maxConnectionsPerUser =
        limitFromEnvironment("BERTH_MAX_CONNECTIONS_PER_USER", limits.maxConnectionsPerUser);
    limits.maxBufferedBytesPerUser =
        limitFromEnvironment("BERTH_MAX_BUFFERED_BYTES_PER_USER", limits.maxBufferedBytesPerUser);
    return limits;
}

constexpr uint32_t kLogFileCount = 1;
constexpr uint64_t kLogSizeLimit = 102400;
constexpr uint32_t kInternalLogFileCount = 4;
constexpr uint64_t kInternalLogSizeLimit = 262144;

// Steps 2 to 5: the rotating log.
void openRotatingLog() {
    BTH_FUNCTION("main");
    const std::filesystem::path logPath =
        BTHGlobalConfiguration::sharedInstance().logDirectory() / "berthd.log";
    const bool internal = DeviceProperties::isInternalBuild();
    const uint32_t count = internal ? kInternalLogFileCount : kLogFileCount;
    const uint64_t limit = internal ? kInternalLogSizeLimit : kLogSizeLimit;
    BTHSetLogFileCount(count);
    auto handle = std::make_shared<BTHLogHandle>(kBTHServiceName, BTHLogLevelNotice);
    // Under the service manager the journal gets every line too; the
    // rotating file stays the record the device keeps.
    if (ServiceManager::loggingToJournal()) handle->enableJournalLogging();
    if (handle->enableDiskLogging(logPath, count, limit)) {
        BTHLogSetHandle(handle);
    } else {
        syslog(LOG_ERR, "Failed to set up rotating logs at path %s", logPath.c_str());
    }
    BTHLogDebug("berthd built at %s %s started", __DATE__, __TIME__);
}

// Step 13: the marker that later launches in this boot skip first-boot work.
void setFirstBootWorkCompleted() {
    BTH_FUNCTION("set_first_boot_work_completed");
    if (!NamedSemaphore::create(kBTHFirstBootSemaphoreName, 0400))
        BTHLogError("Failed to create semaphore %s: %s", kBTHFirstBootSemaphoreName,
                    strerror(errno));
}

// Step 12: follow the key bag's lock state on the main queue.
void registerForLockStateChanges(RunLoop& runLoop) {
    BTH_FUNCTION("main");
    static LockStateNotification notification;
    static BTHLockStateCallback callback(BTHLockStateQueue(),
                                         [] { return LockStateNotification::lockState(); });
    if (!notification.registerForChanges()) {
        BTHLogError("notify_register_dispatch for notification \"%s\" failed; returned %d\n",
                    LockStateNotification::kName, errno);
    } else {
        runLoop.watchReadable(notification.fd(), [] {
            if (notification.drain()) callback.run();
        });
    }
    callback.run();
}

// An orderly stop by the system: the service manager learns the daemon is
// ending, then the process ends at once. Nothing is lost: every log line is
// already on disk, and the stored state survives a stop at any point, as it
// survives SIGKILL.
void watchForTermination(RunLoop& runLoop) {
    BTH_FUNCTION("main");
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGTERM);
    static UniqueFd terminations(::signalfd(-1, &signals, SFD_NONBLOCK | SFD_CLOEXEC));
    if (!terminations) {
        BTHLogError("Failed to watch for termination: %s", strerror(errno));
        return;
    }
    runLoop.watchReadable(terminations.get(), [] {
        ServiceManager::notifyStopping();
        ::_exit(0);
    });
}

// Step 16: the request listener on the concurrent listener queue.
std::unique_ptr<RelayListener> startListener(const std::shared_ptr<WorkQueue>& listenerQueue) {
    BTH_FUNCTION("main");
    std::string why;
    int error = 0;
    std::optional<ServiceCheckIn> checkIn =
        ServiceCheckIn::claim(kBTHServiceName, SOCK_STREAM, 0666, &error, &why);
    if (!checkIn) {
        BTHLogError("unable to start relay service!");
        ServiceManager::notifyStatus("No request socket: " + why);
        return nullptr;
    }
    // The claim (its lock) must outlive the listener: keep it for the process.
    static std::optional<ServiceCheckIn> claim;
    claim = std::move(checkIn);

    RelayListener::Options options;
    options.label = kBTHServiceName;
    options.codeSigning = std::make_shared<CodeSigningRegistry>();
    options.userLimits = userLimitsFromEnvironment();
    options.log = [](int level, const std::string& message) {
        BTH_FUNCTION("BTHProcessRelayEvent");
        BTHLog(level, "%@", message);
    };
    std::unique_ptr<RelayListener> listener =
        RelayListener::make(claim->takeSocket(), listenerQueue, std::move(options), &why);
    if (!listener) {
        BTHLogError("unable to start relay service!");
        ServiceManager::notifyStatus("No request socket: " + why);
        return nullptr;
    }
    listener->setEventHandler([](const std::shared_ptr<RelayConnection>& connection) {
        connection->setEventHandler([](const RelayEvent& event) { BTHProcessRelayEvent(event); });
        connection->resume();
    });
    listener->resume();
    return listener;
}

// What a change of entitlements implies above the code-signing store: the
// all-identifiers lock around processing, staging a withdrawn system
// container, re-counting groups. Connected before the first request.
void connectCodeSigningConsequences() {
    if (BTHCodeSigningMapping* mapping = BTHCodeSigningMapping::sharedInstance())
        mapping->setHooks(BTHMakeCodeSigningHooks(BTHGroupManager::defaultManager()));
}

// A launched app's identity is only as good as the kernel's refusal to let
// the user's other processes attach to it; the service installs a setting
// that restricts attaching, and an administrator who lifts it is told.
void warnIfAppsCanBeAttached() {
    BTH_FUNCTION("main");
    const std::optional<int> level = processAttachRestriction();
    if (processAttachRestricted(level)) return;
    BTHLogWarning(
        "Processes of a user may attach to each other (kernel.yama.ptrace_scope is %@): any "
        "program of an app's user can take over a launched app and speak with its identity",
        level ? std::to_string(*level) : std::string("not available"));
}

}  // namespace

int BTHDaemonMain() {
    BTH_FUNCTION("main");
    // Every thread made from here on inherits the blocked SIGTERM, so the
    // main thread's run loop alone receives it.
    sigset_t termination;
    sigemptyset(&termination);
    sigaddset(&termination, SIGTERM);
    ::pthread_sigmask(SIG_BLOCK, &termination, nullptr);
    RunLoop& runLoop = RunLoop::main();
    RelayTransaction::begin();  // step 1: busy until start-up is done
    BTHFaultInjectionLoadFromEnvironment();
    // Every link-safe open beneath a scratch root starts from it.
    DeviceRoot::keepOpen();
    openRotatingLog();
    BTHSetExceptionReporter(BTHReportUncaughtException);

    if (!BTHDeathRowQueue() || !BTHLockStateQueue()) {
        BTHLogError("Can't create dispatch queues. Exiting.");
        return -1;
    }
    BTHDeathRowQueue()->setTarget(WorkQueue::global(QueuePriority::background));
    BTHClientConnection::sharedClientConnection();
    connectCodeSigningConsequences();
    warnIfAppsCanBeAttached();

    const std::shared_ptr<BTHClientConnection>& daemonClient =
        BTHClientConnection::sharedClientConnection();
    const bool firstBoot = !NamedSemaphore::exists(kBTHFirstBootSemaphoreName);
    if (firstBoot) {
        BTHLogNotice("berthd performing first boot initialization");
        ServiceManager::notifyStatus("Migrating after boot");
        BTHRebootBerthSetup(*daemonClient);
    }
    ServiceManager::notifyStatus("Recovering interrupted replaces");
    daemonClient->berthSetup();

    std::unique_ptr<BTHUpcallServer> upcall = BTHUpcallServer::start(runLoop);
    if (!upcall) {
        BTHLogError("Failed to initialize kernel upcall interface. THIS IS BAD! Exiting.");
        return -1;
    }
    // Holding the upcall endpoint makes this the device's one daemon: blocks
    // left by a previous one died with its assertions.
    BTHApplicationTerminationAssertion::clearStaleRelaunchBlocks();
    registerForLockStateChanges(runLoop);

    if (firstBoot) {
        ServiceManager::notifyStatus("Cleaning up after boot");
        daemonClient->rebootBerthCleanup();
        BTHLogNotice("berthd first boot cleanup complete");
        setFirstBootWorkCompleted();
    }
    ServiceManager::notifyStatus("Cleaning up staging and death row");
    daemonClient->berthCleanup();
    RelayTransaction::end();

    const std::shared_ptr<WorkQueue> listenerQueue =
        WorkQueue::makeConcurrent("sys.kelp.berthd.listener");
    std::unique_ptr<RelayListener> listener = startListener(listenerQueue);
    watchForTermination(runLoop);
    // Without its request socket the daemon still serves the upcall, but it
    // is not ready: the service manager's start-up time limit then decides.
    if (listener) {
        ServiceManager::notifyStatus("Serving requests");
        ServiceManager::notifyReady();
    }
    runLoop.run();
    return 0;
}

}  // namespace berth

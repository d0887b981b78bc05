#include "service/OSTDaemon.h"

#include "Protocol/OSTServices.h"
#include "codesigning/OSTCodeSigningMapping.h"
#include "codesigning/OSTCodeSigningStoreDelegate.h"
#include "migration/OSTContainerMigrator.h"
#include "model/OSTGlobalConfiguration.h"
#include "platform/base/Errno.h"
#include "platform/base/Log.h"
#include "platform/base/Path.h"
#include "platform/device/DeviceCapabilities.h"
#include "platform/device/NamedSemaphore.h"
#include "platform/threads/Transactions.h"
#include "protection/OSTLockStateQueue.h"
#include "service/OSTRequestDispatcher.h"
#include "store/OSTClientConnection.h"
#include "store/OSTContainerCache.h"
#include "upcall/OSTKernServer.h"

#include <sys/epoll.h>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <syslog.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <exception>

namespace ost {

using platform::logAs;
using platform::LogLevel;

namespace {

constexpr const char* listenerQueueName = "com.tamarok.ostrandd.listener";
/// There while the first-boot work of this boot is done; named semaphores do not survive a reboot.
constexpr const char* firstBootMarker = "ostrandd.fb_check";
constexpr mode_t firstBootMarkerMode = 0400;
constexpr const char* lockStateNotificationName = "device-lock-state";
/// How long an orderly end may take. The service launcher loses patience later.
constexpr std::chrono::seconds timeToFinish{20};

struct LogSize {
    unsigned files;
    std::uint64_t fileSize;
};
constexpr LogSize internalBuildLog{.files = 4, .fileSize = 262144};
constexpr LogSize customerLog{.files = 1, .fileSize = 102400};

void set_first_boot_work_completed() {
    if (const auto created = platform::createNamedSemaphore(firstBootMarker, firstBootMarkerMode, 0); !created)
        platform::logError("Failed to create semaphore %s: %s", firstBootMarker, created.error());
}

} // namespace

OSTDaemon::OSTDaemon() : _sockets(platform::ActivatedSockets::fromEnvironment()) {}

OSTDaemon::~OSTDaemon() = default;

bool OSTDaemon::start() {
    platform::Transaction transaction("start-up");
    _openLog();
    logAs(LogLevel::debug, "main", "ostrandd built at %s %s started", __DATE__, __TIME__);
    if (!_createQueues()) {
        logAs(LogLevel::error, "main", "Can't create dispatch queues. Exiting.");
        return false;
    }
    static OSTCodeSigningStoreDelegate codeSigning;
    OSTStoreDelegate::join(codeSigning);
    const auto& store = OSTClientConnection::sharedClientConnection();
    const auto firstBootWorkDone = platform::namedSemaphoreExists(firstBootMarker);
    if (!firstBootWorkDone) {
        // First-boot work destroys transient containers, which are lost when they are of this boot.
        logAs(LogLevel::error, "main", "Failed to look for semaphore %s: %s. Exiting.", firstBootMarker,
              firstBootWorkDone.error());
        return false;
    }
    const bool firstBoot = !*firstBootWorkDone;
    if (firstBoot) {
        logAs(LogLevel::notice, "main", "ostrandd performing first boot initialization");
        OSTClientConnection::rebootContainerManagerSetup(
            [] { return OSTContainerMigrator::sharedInstance().performSynchronousDaemonStartupMigration(); });
    } else {
        OSTContainerCache::sharedInstance().expectChangesOfEarlierProcess();
    }
    store.containerManagerSetup();

    if (_startRunLoop())
        _upcallPort = OSTKernServerStart(*_runLoop, _sockets.takeListener(OSTKernServiceName, SOCK_SEQPACKET));
    if (!_upcallPort) {
        logAs(LogLevel::error, "main", "Failed to initialize kernel upcall interface. THIS IS BAD! Exiting.");
        return false;
    }
    _followLockState();
    if (firstBoot) {
        store.rebootContainerManagerCleanup();
        logAs(LogLevel::notice, "main", "ostrandd first boot cleanup complete");
        set_first_boot_work_completed();
    }
    store.containerManagerCleanup();
    static_cast<void>(OSTCodeSigningMapping::sharedInstance().isAvailable()); // read before clients take descriptors
    transaction.end();
    _startListener();
    return true;
}

void OSTDaemon::_openLog() {
    const auto size = platform::deviceCapability("InternalBuild") ? internalBuildLog : customerLog;
    const auto path =
        platform::pathByAppending(OSTGlobalConfiguration::sharedInstance().logDirectory(), "ostrandd.log");
    const auto opened = platform::Log::shared().open(LogLevel::notice, {path, size.files, size.fileSize});
    if (!opened) {
        ::openlog(OSTServiceName, LOG_PID, LOG_DAEMON);
        ::syslog(LOG_ERR, "Failed to set up rotating logs at path %s", path.c_str());
        ::closelog();
    }
}

bool OSTDaemon::_createQueues() {
    try {
        OSTDeathRowQueue().setTargetBackgroundPriority();
        static_cast<void>(OSTLockStateQueue());
        return true;
    } catch (const std::exception&) {
        return false;
    }
}

bool OSTDaemon::_startRunLoop() {
    auto loop = platform::RunLoop::create();
    if (!loop)
        return false;
    _runLoop = *std::move(loop);
    sigset_t ending;
    ::sigemptyset(&ending);
    ::sigaddset(&ending, SIGTERM);
    ::sigaddset(&ending, SIGINT);
    _signals.reset(::signalfd(-1, &ending, SFD_CLOEXEC | SFD_NONBLOCK));
    auto source = _runLoop->addSource(_signals.get(), EPOLLIN, [this](std::uint32_t) { _runLoop->stop(); });
    if (!source)
        return false;
    _signalSource = *std::move(source);
    _sayWhatIsLeftOutOfLog();
    return true;
}

void OSTDaemon::_sayWhatIsLeftOutOfLog() {
    auto source = _runLoop->addSource(platform::Log::shared().leftOutDescriptor(), EPOLLIN, [](std::uint32_t) {
        platform::Log::shared().sayWhatWasLeftOut(platform::Log::LeftOut::whereTimeIsOver);
    });
    if (source) // else the next line of a user says it
        _leftOutSource = *std::move(source);
}

void OSTDaemon::_followLockState() {
    auto notification =
        platform::DeviceLockStateNotification::registerHandler(*_runLoop, brevind_notification_callback);
    if (notification)
        _lockStateNotification = *std::move(notification);
    else
        logAs(LogLevel::error, "main", "Failed to register for notification %s: %d", lockStateNotificationName,
              notification.error());
    brevind_notification_callback();
}

void OSTDaemon::_startListener() {
    const auto start = [this]() -> std::expected<void, platform::Errno> {
        auto socket = OST_TRY(_sockets.takeListener(OSTServiceName, SOCK_STREAM));
        auto listener = OST_TRY(platform::IPCListener::create(
            std::move(socket), listenerQueueName, [](const std::shared_ptr<platform::IPCConnection>& connection) {
                connection->setMessageHandler(OSTProcessVexelEvent);
                connection->resume();
            }));
        OST_TRY(listener->resume());
        _listener = std::move(listener);
        return {};
    };
    if (!start())
        logAs(LogLevel::error, "main", "unable to start vexel service!");
}

void OSTDaemon::run() {
    _runLoop->run();
    _finish();
}

void OSTDaemon::_finish() {
    const auto deadline = std::chrono::steady_clock::now() + timeToFinish;
    const bool requestsDone = !_listener || _listener->finish(deadline);
    // What waits for an unlock would wait for longer than there is time.
    OSTLockStateQueue().abandon();
    platform::Log::shared().sayWhatWasLeftOut(platform::Log::LeftOut::everywhere);
    if (platform::Transactions::shared().waitUntilNone(deadline) && requestsDone)
        return;
    auto open = platform::Transactions::shared().describeOpen();
    if (!requestsDone)
        open += open.empty() ? "a client's request" : ", a client's request";
    logAs(LogLevel::error, "main", "Ending although still open: %@", open);
    ::_exit(0);
}

} // namespace ost

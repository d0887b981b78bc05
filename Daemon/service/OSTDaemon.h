#pragma once

#include "platform/device/DeviceLockState.h"
#include "platform/ipc/ActivatedSockets.h"
#include "platform/ipc/IPCListener.h"
#include "platform/ipc/UpcallPort.h"
#include "platform/threads/RunLoop.h"

#include <memory>

namespace ost {

/// The daemon process: everything that start-up makes and the run loop needs.
///
/// Threads: the main thread. The order of the members is that of their making; teardown is its reverse.
class OSTDaemon {
public:
    /// Takes the sockets that were handed over, before any other thread runs.
    OSTDaemon();
    OSTDaemon(const OSTDaemon&) = delete;
    OSTDaemon& operator=(const OSTDaemon&) = delete;
    ~OSTDaemon();

    /// Brings the daemon up, holding a transaction, until clients are served. False, with the reason in the log, when
    /// it cannot go on.
    [[nodiscard]] bool start();

    /// Serves until SIGTERM or SIGINT, then finishes what is under way. Does not return when something is still open
    /// after the time there is for that: it then ends the process with status 0.
    void run();

private:
    static void _openLog();
    [[nodiscard]] static bool _createQueues();
    [[nodiscard]] bool _startRunLoop();
    void _sayWhatIsLeftOutOfLog();
    void _followLockState();
    void _startListener();
    void _finish();

    platform::ActivatedSockets _sockets;
    std::unique_ptr<platform::RunLoop> _runLoop;
    platform::FileDescriptor _signals;
    platform::RunLoop::Source _signalSource;
    platform::RunLoop::Source _leftOutSource; ///< lines were left out of the log, and it is time to say so
    std::unique_ptr<platform::UpcallPort> _upcallPort;
    std::unique_ptr<platform::DeviceLockStateNotification> _lockStateNotification;
    std::unique_ptr<platform::IPCListener> _listener;
};

} // namespace ost

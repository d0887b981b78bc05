#pragma once

#include "Device/DeviceImage.h"

#include <sys/types.h>

#include <array>
#include <chrono>
#include <csignal>
#include <filesystem>
#include <string>
#include <vector>

namespace ost::device {

struct BootOptions {
    std::filesystem::path image;
    std::filesystem::path daemon;
    std::vector<std::string> command; ///< empty: run until a signal
};

/// One boot of a device: holds the image, its mounts and the daemon's sockets, and keeps the daemon running.
///
/// The sockets stay with the launcher for the whole boot, so a client that connects while the daemon restarts waits
/// instead of failing. When the launcher itself is killed, the kernel kills the daemon with it, as a power cut would:
/// another boot of the image must not find an old daemon at work.
///
/// Threads: one, and one launcher a process, because it moves the process into another mount namespace and receives its
/// signals. Invariant: at most one daemon and one command exist.
class ServiceLauncher {
public:
    /// Makes everything ready for the daemon's first start. Requires root.
    static Result<ServiceLauncher> prepare(const BootOptions& options);

    /// Keeps the daemon running until SIGTERM or SIGINT arrives or the command has ended, then ends the daemon, and a
    /// command that was interrupted. Returns the exit status of a command that ran (128 and the signal's number when
    /// one ended it), 1 when it could not run because the daemon would not serve, and 0 otherwise.
    [[nodiscard]] int run();

private:
    using Clock = std::chrono::steady_clock;

    /// The way back to where the launcher was started.
    struct HostView {
        platform::FileDescriptor mountNamespace, root, workingDirectory;
    };

    struct Listener {
        const char* name; ///< of the service and of the socket
        int type;
        platform::FileDescriptor socket{};
    };

    explicit ServiceLauncher(DeviceImage image) : _image(std::move(image)) {}

    // Preparation.
    [[nodiscard]] Result<void> _rememberHost();
    [[nodiscard]] Result<void> _openDaemon(const std::filesystem::path& program);
    [[nodiscard]] Result<void> _receiveSignals();
    [[nodiscard]] Result<void> _listen(Listener& listener) const;

    // Supervision.
    void _startDaemonWhenDue();
    void _daemonEnded(int status);
    void _connectProbe();
    void _followProbe();
    void _waitForEvents(Clock::time_point deadline);
    void _takeSignals();
    void _reapProcesses();
    void _endProcess(const pid_t& process, std::chrono::seconds patience);
    void _finish(int status);

    // In the child, after the fork.
    [[noreturn]] void _becomeDaemon(pid_t launcher) const;
    [[noreturn]] void _becomeCommand() const;

    DeviceImage _image;
    HostView _host;
    std::string _daemonPath;
    platform::FileDescriptor _daemonProgram;
    platform::FileDescriptor _runDirectory;
    std::array<Listener, 2> _listeners;
    std::vector<std::string> _command;
    sigset_t _inheritedSignalMask{};
    platform::FileDescriptor _signals;

    pid_t _daemon = 0;         ///< 0: not running
    pid_t _commandProcess = 0; ///< 0: not running
    Clock::time_point _lastRestart{};
    Clock::time_point _nextStart{};
    platform::FileDescriptor _probe; ///< open while the command waits for the daemon to serve
    Clock::time_point _probeDeadline{};
    unsigned _failedStarts = 0; ///< while the probe is open
    bool _finished = false;
    int _status = 0;
};

} // namespace ost::device

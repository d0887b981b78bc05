#include "Device/ServiceLauncher.h"

#include "Protocol/OSTServices.h"
#include "platform/base/Try.h"

#include <elf.h>
#include <fcntl.h>
#include <link.h>
#include <poll.h>
#include <sched.h>
#include <sys/prctl.h>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string_view>

namespace ost::device {

using platform::FileDescriptor;
using namespace std::chrono_literals;

namespace {

/// Between two restarts of a daemon that keeps failing.
constexpr auto restartInterval = 1s;
/// The daemon promises to end 20 s after SIGTERM.
constexpr auto patienceWithDaemon = 25s;
/// What a command may need to tidy up when it is interrupted.
constexpr auto patienceWithCommand = 5s;
/// How long a command waits for its device: a first start may have migrations to do, but nobody waits for ever.
constexpr auto patienceWithStart = 120s;
constexpr unsigned failedStartsBeforeGivingUp = 3;

constexpr int firstHandedOver = STDERR_FILENO + 1;
/// Descriptors that a child needs until it executes its program stay above those handed over.
constexpr int firstKept = 16;

/// Request number 1: {"Command": 0}
constexpr std::string_view probeRequest{"\x0a\0\0\0\x01\0\0\0\xa1\x67"
                                        "Command\0",
                                        18};

template<typename... Arguments>
void say(const char* format, Arguments... arguments) {
    std::fprintf(stderr, (std::string("ostrand-device: ") + format + '\n').c_str(), arguments...);
}

[[noreturn]] void failInChild(const char* what) {
    say("Failed to %s: %s", what, std::strerror(errno));
    ::_exit(127);
}

Failure failure(const std::string& what) { return {what, errno}; }

Result<FileDescriptor> keepAbove(FileDescriptor file, const std::string& what) {
    if (!file)
        return std::unexpected(failure(what));
    FileDescriptor kept(::fcntl(file.get(), F_DUPFD_CLOEXEC, firstKept));
    if (!kept)
        return std::unexpected(failure(what));
    return kept;
}

/// Whether a program names an interpreter, which then loads the libraries of the root directory it is run in.
bool isDynamicallyLinked(const FileDescriptor& program) {
    ElfW(Ehdr) header{};
    if (::pread(program.get(), &header, sizeof header, 0) != sizeof header ||
        std::memcmp(header.e_ident, ELFMAG, SELFMAG) != 0)
        return false;
    for (unsigned index = 0; index < header.e_phnum; ++index) {
        ElfW(Phdr) segment{};
        const auto offset = static_cast<off_t>(header.e_phoff + index * sizeof segment);
        if (::pread(program.get(), &segment, sizeof segment, offset) != sizeof segment)
            return false;
        if (segment.p_type == PT_INTERP)
            return true;
    }
    return false;
}

/// The address of a socket below an open directory, however long the directory's own path is.
sockaddr_un addressBelow(const FileDescriptor& directory, const char* name) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::snprintf(address.sun_path, sizeof address.sun_path, "/proc/self/fd/%d/%s", directory.get(), name);
    return address;
}

int exitStatus(int status) { return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status); }

std::vector<char*> pointersTo(std::vector<std::string>& strings) {
    std::vector<char*> pointers;
    for (std::string& string : strings)
        pointers.push_back(string.data());
    pointers.push_back(nullptr);
    return pointers;
}

/// The daemon reads no configuration from its environment; its sanitizers do.
std::vector<std::string> daemonEnvironment(std::string_view socketNames, std::size_t sockets) {
    std::vector<std::string> environment{"LISTEN_PID=" + std::to_string(::getpid()),
                                         "LISTEN_FDS=" + std::to_string(sockets),
                                         "LISTEN_FDNAMES=" + std::string(socketNames)};
    for (char** variable = environ; *variable != nullptr; ++variable)
        if (std::strstr(*variable, "SAN_OPTIONS=") != nullptr)
            environment.emplace_back(*variable);
    return environment;
}

} // namespace

// Preparation

Result<ServiceLauncher> ServiceLauncher::prepare(const BootOptions& options) {
    ServiceLauncher launcher(OST_TRY(DeviceImage::openOrMake(options.image)));
    launcher._command = options.command;
    OST_TRY(launcher._image.reserve());
    // Before the sockets appear: a client that sees them may end us already.
    OST_TRY(launcher._receiveSignals());
    OST_TRY(launcher._rememberHost());
    OST_TRY(launcher._openDaemon(options.daemon));
    OST_TRY(launcher._image.mountDeviceFileSystems());
    if (isDynamicallyLinked(launcher._daemonProgram))
        OST_TRY(launcher._image.mountHostLibraries());
    launcher._runDirectory = OST_TRY(launcher._image.openEmptiedRunDirectory());
    launcher._listeners = {Listener{OSTServiceName, SOCK_STREAM}, Listener{OSTKernServiceName, SOCK_SEQPACKET}};
    for (Listener& listener : launcher._listeners)
        OST_TRY(launcher._listen(listener));
    return launcher;
}

Result<void> ServiceLauncher::_rememberHost() {
    _host.mountNamespace.reset(::open("/proc/self/ns/mnt", O_RDONLY | O_CLOEXEC));
    _host.root.reset(::open("/", O_PATH | O_DIRECTORY | O_CLOEXEC));
    _host.workingDirectory.reset(::open(".", O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!_host.mountNamespace || !_host.root || !_host.workingDirectory)
        return std::unexpected(failure("open the host's mount namespace"));
    return {};
}

Result<void> ServiceLauncher::_openDaemon(const std::filesystem::path& program) {
    _daemonPath = program.string();
    _daemonProgram =
        OST_TRY(keepAbove(FileDescriptor(::open(program.c_str(), O_RDONLY | O_CLOEXEC)), "open " + _daemonPath));
    return {};
}

Result<void> ServiceLauncher::_listen(Listener& listener) const {
    listener.socket = OST_TRY(
        keepAbove(FileDescriptor(::socket(AF_UNIX, listener.type | SOCK_CLOEXEC, 0)), std::string("make a socket")));
    const sockaddr_un address = addressBelow(_runDirectory, listener.name);
    const mode_t umask = ::umask(0111); // Everybody may connect; the daemon looks at who it is.
    const int bound = ::bind(listener.socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address);
    ::umask(umask);
    // Whose a packet is must be known of the first one, too, which may come before the daemon is there.
    const int passCredentials = listener.type == SOCK_SEQPACKET ? 1 : 0;
    if (bound != 0 ||
        ::setsockopt(listener.socket.get(), SOL_SOCKET, SO_PASSCRED, &passCredentials, sizeof passCredentials) != 0 ||
        ::listen(listener.socket.get(), SOMAXCONN) != 0)
        return std::unexpected(failure(std::string("listen on ") + listener.name));
    return {};
}

Result<void> ServiceLauncher::_receiveSignals() {
    ::signal(SIGCHLD, SIG_DFL); // Ignored by our parent, it would take the children's status away.
    sigset_t signals;
    ::sigemptyset(&signals);
    for (const int signal : {SIGTERM, SIGINT, SIGCHLD})
        ::sigaddset(&signals, signal);
    ::sigprocmask(SIG_BLOCK, &signals, &_inheritedSignalMask);
    _signals.reset(::signalfd(-1, &signals, SFD_NONBLOCK | SFD_CLOEXEC));
    if (!_signals)
        return std::unexpected(failure("receive signals"));
    return {};
}

// Supervision

int ServiceLauncher::run() {
    if (!_command.empty()) {
        _connectProbe();
        _probeDeadline = Clock::now() + patienceWithStart;
    }
    while (!_finished) {
        _startDaemonWhenDue();
        const auto restart = _daemon == 0 ? _nextStart : Clock::time_point::max();
        _waitForEvents(_probe ? std::min(restart, _probeDeadline) : restart);
        _followProbe();
    }
    _endProcess(_commandProcess, patienceWithCommand);
    _endProcess(_daemon, patienceWithDaemon);
    return _status;
}

void ServiceLauncher::_finish(int status) {
    _status = status;
    _finished = true;
}

void ServiceLauncher::_startDaemonWhenDue() {
    if (_daemon != 0 || Clock::now() < _nextStart)
        return;
    const pid_t launcher = ::getpid();
    const pid_t child = ::fork();
    if (child == 0)
        _becomeDaemon(launcher);
    if (child < 0) {
        say("Failed to start the daemon: %s", std::strerror(errno));
        _nextStart = Clock::now() + restartInterval;
        return;
    }
    _daemon = child;
}

void ServiceLauncher::_daemonEnded(int status) {
    _daemon = 0;
    if (_finished)
        return;
    if (WIFSIGNALED(status))
        say("The daemon was ended by signal %d, starting it again", WTERMSIG(status));
    else
        say("The daemon ended with status %d, starting it again", WEXITSTATUS(status));
    if (_probe)
        ++_failedStarts;
    // At once, unless that is what was done a moment ago.
    _nextStart = std::max(Clock::now(), _lastRestart + restartInterval);
    _lastRestart = _nextStart;
}

/// Sends the daemon a request that every unsigned program may make and that gets no answer: the daemon closes the
/// connection when it comes to it, and until then the connection waits in the socket's queue.
void ServiceLauncher::_connectProbe() {
    _probe.reset(::socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
    const sockaddr_un address = addressBelow(_runDirectory, _listeners[0].name);
    if (!_probe || ::connect(_probe.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0 ||
        ::send(_probe.get(), probeRequest.data(), probeRequest.size(), MSG_NOSIGNAL) < 0) {
        say("Failed to connect to the daemon's socket: %s", std::strerror(errno));
        _finish(EXIT_FAILURE);
    }
}

void ServiceLauncher::_followProbe() {
    if (!_probe || _finished)
        return;
    if (_failedStarts >= failedStartsBeforeGivingUp || Clock::now() >= _probeDeadline) {
        say("%s does not serve", _daemonPath.c_str());
        _finish(EXIT_FAILURE);
        return;
    }
    pollfd probe{_probe.get(), POLLIN, 0};
    if (::poll(&probe, 1, 0) <= 0)
        return;
    if (_daemon == 0) { // It was not an answer: the daemon died with our connection in its hands.
        _connectProbe();
        return;
    }
    _probe.reset();
    _commandProcess = ::fork();
    if (_commandProcess == 0)
        _becomeCommand();
    if (_commandProcess < 0) {
        _commandProcess = 0;
        say("Failed to start the command: %s", std::strerror(errno));
        _finish(EXIT_FAILURE);
    }
}

void ServiceLauncher::_waitForEvents(Clock::time_point deadline) {
    int timeout = -1;
    if (deadline != Clock::time_point::max())
        timeout = static_cast<int>(
            std::max(0ms, std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now())).count());
    std::array<pollfd, 2> sources{pollfd{_signals.get(), POLLIN, 0}, pollfd{_probe.get(), POLLIN, 0}};
    ::poll(sources.data(), sources.size(), timeout);
    _takeSignals();
    _reapProcesses();
}

void ServiceLauncher::_takeSignals() {
    signalfd_siginfo signal{};
    while (::read(_signals.get(), &signal, sizeof signal) == sizeof signal)
        if (signal.ssi_signo != SIGCHLD)
            _finish(0);
}

void ServiceLauncher::_reapProcesses() {
    int status = 0;
    for (pid_t process = 0; (process = ::waitpid(-1, &status, WNOHANG)) > 0;) {
        if (process == _daemon) {
            _daemonEnded(status);
        } else if (process == _commandProcess) {
            _commandProcess = 0;
            _finish(exitStatus(status));
        }
    }
}

/// Ends one of the processes, by force when it does not end by itself in time.
void ServiceLauncher::_endProcess(const pid_t& process, std::chrono::seconds patience) {
    if (process == 0)
        return;
    ::kill(process, SIGTERM);
    const auto deadline = Clock::now() + patience;
    while (process != 0 && Clock::now() < deadline)
        _waitForEvents(deadline);
    if (process == 0)
        return;
    say("Process %d does not end, killing it", process);
    ::kill(process, SIGKILL);
    while (process != 0)
        _waitForEvents(Clock::time_point::max());
}

// Children

/// What the launcher has open, even what it was started with, stays behind: the daemon gets the sockets and standard
/// output and error.
void ServiceLauncher::_becomeDaemon(pid_t launcher) const {
    ::setsid(); // A terminal's interrupt is for the launcher, which then ends the daemon in order.
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    if (::getppid() != launcher)
        ::_exit(EXIT_FAILURE);
    if (::dup2(::open("/dev/null", O_RDONLY | O_CLOEXEC), STDIN_FILENO) < 0)
        failInChild("open /dev/null");
    if (const auto changed = _image.changeRoot(); !changed)
        failInChild("enter the image");

    int target = firstHandedOver;
    std::string names;
    for (const Listener& listener : _listeners) {
        if (::dup2(listener.socket.get(), target++) < 0)
            failInChild("hand over a socket");
        names += names.empty() ? "" : ":";
        names += listener.name;
    }
    if (::close_range(static_cast<unsigned>(target), ~0U, CLOSE_RANGE_CLOEXEC) != 0)
        failInChild("keep descriptors from the daemon");

    for (int signal = 1; signal < NSIG; ++signal)
        ::signal(signal, SIG_DFL);
    sigset_t none;
    ::sigemptyset(&none);
    ::sigprocmask(SIG_SETMASK, &none, nullptr);

    std::vector<std::string> arguments{_daemonPath};
    std::vector<std::string> environment = daemonEnvironment(names, _listeners.size());
    ::fexecve(_daemonProgram.get(), pointersTo(arguments).data(), pointersTo(environment).data());
    failInChild("execute the daemon");
}

void ServiceLauncher::_becomeCommand() const {
    // Entering a mount namespace also changes root and working directory to the namespace's own.
    if (::setns(_host.mountNamespace.get(), CLONE_NEWNS) != 0 || ::fchdir(_host.root.get()) != 0 ||
        ::chroot(".") != 0 || ::fchdir(_host.workingDirectory.get()) != 0)
        failInChild("return to the host");
    ::setenv("OSTRAND_DEVICE", _image.path().c_str(), 1);
    ::sigprocmask(SIG_SETMASK, &_inheritedSignalMask, nullptr);
    std::vector<std::string> arguments = _command;
    ::execvp(arguments[0].c_str(), pointersTo(arguments).data());
    failInChild(("execute " + arguments[0]).c_str());
}

} // namespace ost::device

#include "Client/LaunchedProcess.h"

#include <fcntl.h>
#include <grp.h>
#include <linux/capability.h>
#include <linux/close_range.h>
#include <linux/keyctl.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <utility>

namespace ostrand {

using ost::platform::Errno;
using ost::platform::FileDescriptor;

namespace {

constexpr std::array forwardedSignals{SIGHUP, SIGINT, SIGQUIT, SIGTERM, SIGUSR1, SIGUSR2, SIGCONT, SIGTSTP, SIGWINCH};

// The steps of the child, each of which gives whether it succeeded, else with errno set.

/// A program that shared the session could type into its terminal, which is read by whoever started it.
bool leaveSession(const Launch&) { return ::setsid() >= 0; }

/// Otherwise a program could read the keys of the one who started it.
bool leaveKeyring(const Launch&) {
    return ::syscall(SYS_keyctl, KEYCTL_JOIN_SESSION_KEYRING, nullptr) >= 0 || errno == ENOSYS || errno == EPERM;
}

bool dropBoundingSet(const Launch&) {
    for (unsigned long capability = 0; ::prctl(PR_CAPBSET_DROP, capability, 0, 0, 0) == 0;)
        ++capability;
    return errno == EINVAL; // behind the last
}

bool takeGroups(const Launch& launch) {
    const auto own = launch.groups.empty() ? gid_t(-1) : launch.groups.front();
    if (own == gid_t(-1)) { // which would change nothing
        errno = EINVAL;
        return false;
    }
    return ::setgroups(launch.groups.size(), launch.groups.data()) == 0 && ::setresgid(own, own, own) == 0;
}

bool becomeUser(const Launch& launch) {
    if (launch.user == uid_t(-1)) {
        errno = EINVAL;
        return false;
    }
    return ::setresuid(launch.user, launch.user, launch.user) == 0;
}

bool dropCapabilities(const Launch&) {
    __user_cap_header_struct header{.version = _LINUX_CAPABILITY_VERSION_3, .pid = 0};
    const std::array<__user_cap_data_struct, _LINUX_CAPABILITY_U32S_3> none{};
    return ::syscall(SYS_capset, &header, none.data()) == 0;
}

bool giveUpPrivileges(const Launch&) { return ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0; }

bool enterDirectory(const Launch& launch) { return ::fchdir(launch.workingDirectory.get()) == 0; }

bool enterConfinement(const Launch& launch) {
    const auto entered = launch.confinement ? launch.confinement->enter() : std::expected<void, Errno>();
    if (!entered)
        errno = entered.error();
    return entered.has_value();
}

bool leaveDescriptors(const Launch&) {
    return ::syscall(SYS_close_range, STDERR_FILENO + 1, ~0U, CLOSE_RANGE_CLOEXEC) == 0;
}

std::vector<char*> pointersTo(const std::vector<std::string>& texts) {
    std::vector<char*> pointers;
    pointers.reserve(texts.size() + 1);
    for (const auto& text : texts)
        pointers.push_back(const_cast<char*>(text.c_str()));
    pointers.push_back(nullptr);
    return pointers;
}

bool execute(const Launch& launch) {
    const auto arguments = pointersTo(launch.arguments), environment = pointersTo(launch.environment);
    if (launch.program.isScript())
        ::execve(launch.program.path().c_str(), arguments.data(), environment.data());
    else
        ::syscall(SYS_execveat, launch.program.file(), "", arguments.data(), environment.data(), AT_EMPTY_PATH);
    return false;
}

struct Step {
    const char* doing;
    bool (*take)(const Launch& launch);
};

/// In this order: what needs root comes before the user is changed, and what the user must be able to do after it.
constexpr std::array steps{
    Step{"leave the session", leaveSession},        Step{"give up capabilities for good", dropBoundingSet},
    Step{"take the user's groups", takeGroups},     Step{"become the user", becomeUser},
    Step{"give up capabilities", dropCapabilities}, Step{"give up new privileges", giveUpPrivileges},
    Step{"leave the keyring", leaveKeyring},        Step{"enter the data container", enterDirectory},
    Step{"be confined", enterConfinement},          Step{"leave descriptors behind", leaveDescriptors},
    Step{"execute the program", execute},
};

/// What the child says on the channel when a step fails.
struct FailedStep {
    std::size_t index;
    int error;
};

bool awaitRelease(int channel) {
    char go = 0;
    ssize_t count = 0;
    while ((count = ::recv(channel, &go, sizeof go, 0)) < 0 && errno == EINTR)
        ;
    return count == 1;
}

[[noreturn]] void runChild(const Launch& launch, int channel, const sigset_t& mask) {
    constexpr int notRun = 127;
    if (!awaitRelease(channel))
        ::_exit(notRun);
    ::sigprocmask(SIG_SETMASK, &mask, nullptr);
    for (std::size_t index = 0; index < steps.size(); ++index) {
        if (steps[index].take(launch))
            continue;
        const FailedStep failed{.index = index, .error = errno};
        ::send(channel, &failed, sizeof failed, MSG_NOSIGNAL);
        break;
    }
    ::_exit(notRun);
}

sigset_t handledSignals() {
    sigset_t signals;
    ::sigemptyset(&signals);
    ::sigaddset(&signals, SIGCHLD);
    for (const int signal : forwardedSignals)
        ::sigaddset(&signals, signal);
    return signals;
}

} // namespace

std::expected<LaunchedProcess, Errno> LaunchedProcess::hold(const Launch& launch) {
    std::array<int, 2> ends{};
    if (::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends.data()) != 0)
        return std::unexpected(errno);
    FileDescriptor ours(ends[0]), childs(ends[1]);
    const auto signals = handledSignals();
    sigset_t formerMask;
    ::signal(SIGCHLD, SIG_DFL); // Ignored by our parent, it would take the child's status away.
    ::sigprocmask(SIG_BLOCK, &signals, &formerMask);
    const pid_t child = ::fork();
    if (child == 0) {
        ours.reset(); // Else the child would not see the end of this process.
        runChild(launch, childs.get(), formerMask);
    }
    const int error = errno;
    if (child > 0)
        return LaunchedProcess(std::move(ours), child, formerMask);
    ::sigprocmask(SIG_SETMASK, &formerMask, nullptr);
    return std::unexpected(error);
}

LaunchedProcess::LaunchedProcess(LaunchedProcess&& other) noexcept
    : _channel(std::move(other._channel)), _id(std::exchange(other._id, 0)), _formerMask(other._formerMask) {}

LaunchedProcess::~LaunchedProcess() {
    if (_id == 0)
        return;
    _channel.reset();
    while (::waitpid(_id, nullptr, 0) < 0 && errno == EINTR)
        ;
    ::sigprocmask(SIG_SETMASK, &_formerMask, nullptr);
}

std::expected<void, LaunchFailure> LaunchedProcess::release() {
    constexpr char go = 1;
    ::send(_channel.get(), &go, sizeof go, MSG_NOSIGNAL); // A child that is gone already has left its status.
    FailedStep failed{};
    ssize_t count = 0;
    while ((count = ::recv(_channel.get(), &failed, sizeof failed, 0)) < 0 && errno == EINTR)
        ;
    _channel.reset();
    if (count == sizeof failed && failed.index < steps.size())
        return std::unexpected(LaunchFailure{steps[failed.index].doing, failed.error});
    return {};
}

int LaunchedProcess::waitForEnd() {
    constexpr int signalBase = 128;
    const auto signals = handledSignals();
    while (true) {
        siginfo_t ended{};
        if (::waitid(P_PID, static_cast<id_t>(_id), &ended, WEXITED | WNOWAIT | WNOHANG) == 0 && ended.si_pid == _id)
            return ended.si_code == CLD_EXITED ? ended.si_status : signalBase + ended.si_status;
        siginfo_t signal{};
        if (::sigwaitinfo(&signals, &signal) > 0 && signal.si_signo != SIGCHLD)
            _forward(signal);
    }
}

/// What comes from a terminal is for the whole job, what comes from a process for the program alone. A shell is a
/// process, too, when it continues what its terminal has stopped.
void LaunchedProcess::_forward(const siginfo_t& signal) const {
    const bool isForAll = signal.si_code == SI_KERNEL || signal.si_signo == SIGCONT;
    const pid_t receiver = isForAll ? -_id : _id;
    const bool isStop = signal.si_signo == SIGTSTP;
    // The child's group has nobody who could continue it, so the softer signal would do nothing.
    ::kill(receiver, isStop ? SIGSTOP : signal.si_signo);
    if (isStop)
        ::raise(SIGSTOP);
}

} // namespace ostrand

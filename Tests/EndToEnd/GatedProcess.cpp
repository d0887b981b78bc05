#include "EndToEnd/GatedProcess.h"

#include <linux/filter.h>
#include <linux/seccomp.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <cstddef>
#include <cstring>
#include <system_error>
#include <vector>

namespace ost::test {

using platform::FileDescriptor;

namespace {

struct Call {
    int number;
    const char* name;
    bool onDescriptor; ///< counts when its first argument is the descriptor of a file
};

/// What changes the file system, and what finds out about it and may fail. Not among them: reading files that are open.
constexpr std::array gatedCalls{
    Call{SYS_openat, "openat", false},
    Call{SYS_openat2, "openat2", false},
    Call{SYS_mkdirat, "mkdirat", false},
    Call{SYS_renameat, "renameat", false},
    Call{SYS_renameat2, "renameat2", false},
    Call{SYS_unlinkat, "unlinkat", false},
    Call{SYS_symlinkat, "symlinkat", false},
    Call{SYS_linkat, "linkat", false},
    Call{SYS_newfstatat, "newfstatat", false},
    Call{SYS_statx, "statx", false},
    Call{SYS_fchmodat, "fchmodat", false},
    Call{SYS_fchownat, "fchownat", false},
    Call{SYS_setxattr, "setxattr", false},
    Call{SYS_getxattr, "getxattr", false},
    Call{SYS_readlinkat, "readlinkat", false},
    Call{SYS_fchmod, "fchmod", true},
    Call{SYS_fchown, "fchown", true},
    Call{SYS_fsetxattr, "fsetxattr", true},
    Call{SYS_fgetxattr, "fgetxattr", true},
    Call{SYS_fremovexattr, "fremovexattr", true},
    Call{SYS_getdents64, "getdents64", true},
    Call{SYS_write, "write", true},
    Call{SYS_ftruncate, "ftruncate", true},
    Call{SYS_fsync, "fsync", true},
    Call{SYS_fdatasync, "fdatasync", true},
    Call{SYS_syncfs, "syncfs", true},
#ifdef SYS_mkdir // machines with calls for paths without a directory
    Call{SYS_open, "open", false},
    Call{SYS_mkdir, "mkdir", false},
    Call{SYS_rename, "rename", false},
    Call{SYS_unlink, "unlink", false},
    Call{SYS_chmod, "chmod", false},
    Call{SYS_readlink, "readlink", false},
#endif
};

void require(bool succeeded, const char* what) {
    if (!succeeded)
        throw std::system_error(errno, std::generic_category(), what);
}

/// Puts the calling thread, and whatever it starts, behind a gate. The descriptor of the gate, or -1.
int closeGate() {
    std::vector<sock_filter> filter{BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr))};
    for (const Call& call : gatedCalls) {
        filter.push_back(BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, static_cast<unsigned>(call.number), 0, 1));
        filter.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_USER_NOTIF));
    }
    filter.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW));
    sock_fprog program{static_cast<unsigned short>(filter.size()), filter.data()};
    return static_cast<int>(
        ::syscall(SYS_seccomp, SECCOMP_SET_MODE_FILTER, SECCOMP_FILTER_FLAG_NEW_LISTENER, &program));
}

/// The child's part: `parent` is told the gate, and answers when it has it.
[[noreturn]] void runBehindGate(int parent, const std::function<int()>& body) {
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    const int gate = closeGate();
    const int failure = gate < 0 ? -errno : gate;
    char answer = 0;
    if (::send(parent, &failure, sizeof failure, 0) != sizeof failure || gate < 0 || ::recv(parent, &answer, 1, 0) != 1)
        ::_exit(127);
    ::close(gate);
    ::close(parent);
    ::_exit(body());
}

/// Whether a descriptor of another thread is that of a file. The standard ones are the test's.
bool isFile(pid_t thread, std::uint64_t descriptor) {
    if (descriptor <= STDERR_FILENO)
        return false;
    struct stat status{};
    const auto path = "/proc/" + std::to_string(thread) + "/fd/" + std::to_string(static_cast<int>(descriptor));
    return ::stat(path.c_str(), &status) == 0 && (S_ISREG(status.st_mode) || S_ISDIR(status.st_mode));
}

} // namespace

GatedProcess::GatedProcess(const std::function<int()>& body, const Fault& fault, GatedCallWatcher watcher)
    : _tell(std::move(watcher)), _fault(fault) {
    std::array<int, 2> ends{};
    require(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends.data()) == 0, "socketpair");
    const FileDescriptor own(ends[0]);
    FileDescriptor childs(ends[1]);
    _id = ::fork();
    require(_id >= 0, "fork");
    if (_id == 0)
        runBehindGate(childs.get(), body);
    childs.reset();
    _process.reset(static_cast<int>(::syscall(SYS_pidfd_open, _id, 0)));
    int gate = -ECHILD;
    if (::recv(own.get(), &gate, sizeof gate, MSG_WAITALL) != sizeof gate || gate < 0) {
        wait();
        throw std::system_error(-gate, std::generic_category(), "A process cannot be put behind a gate");
    }
    _gate.reset(static_cast<int>(::syscall(SYS_pidfd_getfd, _process.get(), gate, 0)));
    require(_gate && ::send(own.get(), "", 1, 0) == 1, "take the gate");
    _watcher = std::thread([this] { _watchGate(); });
}

GatedProcess::~GatedProcess() {
    if (_id == 0)
        return;
    kill();
    wait();
}

void GatedProcess::prepare(const Fault& fault) {
    const std::lock_guard lock(_mutex);
    _fault = fault;
    _course = {};
}

GatedProcess::Course GatedProcess::conclude() {
    const std::lock_guard lock(_mutex);
    _fault = {};
    return std::exchange(_course, {});
}

void GatedProcess::kill() const { ::syscall(SYS_pidfd_send_signal, _process.get(), SIGKILL, nullptr, 0); }

int GatedProcess::wait() {
    int status = 0;
    while (::waitpid(_id, &status, 0) < 0)
        require(errno == EINTR, "wait");
    _id = 0;
    if (_watcher.joinable())
        _watcher.join();
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

void GatedProcess::_watchGate() {
    for (;;) {
        pollfd gate{_gate.get(), POLLIN, 0};
        ::poll(&gate, 1, -1);
        if ((gate.revents & POLLIN) == 0)
            return; // Nobody is behind it any more.
        seccomp_notif notification{};
        if (::ioctl(_gate.get(), SECCOMP_IOCTL_NOTIF_RECV, &notification) != 0)
            continue; // Who asked has been killed.
        std::array<std::uint64_t, std::size(notification.data.args)> arguments{};
        std::ranges::copy(notification.data.args, arguments.begin());
        const auto verdict = _judge({static_cast<pid_t>(notification.pid), notification.data.nr, arguments.data()});
        seccomp_notif_resp response{.id = notification.id, .val = 0, .error = -verdict.error, .flags = 0};
        if (verdict.pass)
            response.flags = SECCOMP_USER_NOTIF_FLAG_CONTINUE;
        if (verdict.pass || verdict.error != 0)
            ::ioctl(_gate.get(), SECCOMP_IOCTL_NOTIF_SEND, &response);
    }
}

GatedProcess::Verdict GatedProcess::_judge(const GatedCall& made) {
    const auto* const call = std::ranges::find(gatedCalls, made.number, &Call::number);
    if (call->onDescriptor && !isFile(made.thread, made.arguments[0]))
        return {};
    const std::lock_guard lock(_mutex);
    const unsigned ordinal = ++_course.calls;
    const bool befalls = _fault.kind == Fault::Kind::failForGood ? ordinal >= _fault.call : ordinal == _fault.call;
    if (_fault.kind == Fault::Kind::none || !befalls) {
        if (_tell)
            _tell(made);
        return {};
    }
    if (_course.faultedCall.empty())
        _course.faultedCall = call->name;
    if (_fault.kind != Fault::Kind::kill)
        return {.pass = false, .error = _fault.error};
    kill();
    return {.pass = false, .error = 0};
}

} // namespace ost::test

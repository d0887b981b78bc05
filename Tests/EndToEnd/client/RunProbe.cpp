// A program for `ostrandctl run`, which tries what it must not be able to do. Prints a line "NAME ERRNO" for each
// attempt, 0 when it succeeded.
//
// Usage: run-probe reach NEIGHBOUR PID | await

#include <fcntl.h>
#include <sched.h>
#include <signal.h> // NOLINT(modernize-deprecated-headers): kill is POSIX's
#include <sys/mount.h>
#include <sys/ptrace.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <string>

namespace {

void attempt(const char* name, const std::function<bool()>& act) {
    errno = 0;
    const bool done = act();
    std::printf("%s %d\n", name, done ? 0 : errno);
}

bool opens(const std::string& path, int flags = O_RDONLY) { return ::open(path.c_str(), flags, 0600) >= 0; }

bool connects(const char* abstractName) {
    sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
    std::strcpy(address.sun_path + 1, abstractName);
    const auto size = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + 1 + std::strlen(abstractName));
    return ::connect(::socket(AF_UNIX, SOCK_STREAM, 0), reinterpret_cast<const sockaddr*>(&address), size) == 0;
}

bool reads(pid_t process, void* address) {
    char byte = 0;
    const iovec here{&byte, 1}, there{address, 1};
    return ::process_vm_readv(process, &here, 1, &there, 1, 0) == 1;
}

/// Its own container, and processes of its own.
void useWhatIsOwn() {
    attempt("own-write", [] { return opens("file", O_WRONLY | O_CREAT) && ::truncate("file", 10) == 0; });
    attempt("own-move", [] {
        return ::mkdir("from", 0700) == 0 && opens("from/a", O_WRONLY | O_CREAT) && ::rename("from/a", "tmp/a") == 0;
    });
    attempt("own-link", [] { return ::link("tmp/a", "Documents/a") == 0 && ::symlink("x", "link") == 0; });
    attempt("own-signal", [] {
        const pid_t child = ::fork();
        if (child == 0)
            ::pause();
        return ::kill(child, SIGKILL) == 0 && ::waitpid(child, nullptr, 0) == child;
    });
}

/// The files of a neighbour, by every road.
void reachFiles(const std::string& neighbour, const std::string& process) {
    const auto secret = neighbour + "/secret", proc = "/proc/" + process;
    attempt("read", [&] { return opens(secret); });
    attempt("write", [&] { return opens(secret, O_WRONLY | O_APPEND); });
    attempt("truncate", [&] { return ::truncate(secret.c_str(), 0) == 0; });
    attempt("create", [&] { return opens(neighbour + "/new", O_WRONLY | O_CREAT); });
    attempt("remove", [&] { return ::unlink(secret.c_str()) == 0; });
    attempt("list", [&] { return opens(neighbour, O_RDONLY | O_DIRECTORY); });
    attempt("dots", [&] { return opens("../" + neighbour.substr(neighbour.rfind('/') + 1) + "/secret"); });
    attempt("link", [&] { return ::symlink(secret.c_str(), "to-secret") == 0 && opens("to-secret"); });
    attempt("hard-link", [&] { return ::link(secret.c_str(), "secret") == 0; });
    attempt("move-in", [&] { return ::rename(secret.c_str(), "secret") == 0; });
    attempt("move-out", [&] { return ::rename("file", (neighbour + "/file").c_str()) == 0; });
    attempt("change-directory", [&] {
        const bool there = ::chdir(neighbour.c_str()) == 0 && opens("secret");
        const int error = errno;
        [[maybe_unused]] const int back = ::chdir(std::getenv("HOME"));
        errno = error;
        return there;
    });
    attempt("own-root", [&] { return opens("/proc/self/root" + secret); });
    attempt("others-root", [&] { return opens(proc + "/root" + secret); });
    attempt("others-directory", [&] { return opens(proc + "/cwd/secret"); });
    attempt("others-descriptor", [&] { return opens(proc + "/fd/0"); });
    attempt("others-memory", [&] { return opens(proc + "/mem"); });
}

/// A process of the same user that is not confined.
void reachProcess(pid_t process) {
    attempt("trace", [&] { return ::ptrace(PTRACE_ATTACH, process, nullptr, nullptr) == 0; });
    attempt("read-memory", [&] { return reads(process, reinterpret_cast<void*>(&reachProcess)); });
    attempt("signal", [&] { return ::kill(process, SIGTERM) == 0; });
    attempt("abstract-socket", [] { return connects("run-tests"); });
}

void regainRights() {
    attempt("set-user", [] { return ::setuid(0) == 0; });
    attempt("set-user-bit", [] {
        errno = EPERM;
        return ::geteuid() == 0 || ::getegid() == 0;
    });
    attempt("descriptors", [] { return ::fcntl(9, F_GETFD) >= 0; });
    attempt("terminal", [] { return ::getsid(0) != ::getpid() || ::open("/dev/tty", O_RDWR) >= 0; });
    attempt("execute-own", [] {
        const int file = ::open("script", O_WRONLY | O_CREAT, 0755);
        [[maybe_unused]] const auto written = ::write(file, "#!/bin/sh\n", 10);
        ::close(file);
        ::execl("script", "script", nullptr);
        return false;
    });
    attempt("mount", [] {
        return ::unshare(CLONE_NEWUSER | CLONE_NEWNS) == 0 && ::mount("none", "tmp", "tmpfs", 0, nullptr) == 0;
    });
}

/// Says that it waits for SIGTERM, and ends with 42 when that comes.
int await() {
    sigset_t signals;
    ::sigemptyset(&signals);
    ::sigaddset(&signals, SIGTERM);
    ::sigprocmask(SIG_BLOCK, &signals, nullptr);
    std::puts("waiting");
    std::fflush(stdout);
    int signal = 0;
    return ::sigwait(&signals, &signal) == 0 && signal == SIGTERM ? 42 : 1;
}

} // namespace

int main(int count, char** arguments) {
    const std::string verb = count > 1 ? arguments[1] : "";
    if (verb == "await")
        return await();
    if (verb != "reach" || count != 4)
        return 2;
    useWhatIsOwn();
    reachFiles(arguments[2], arguments[3]);
    reachProcess(std::atoi(arguments[3]));
    regainRights();
    return 0;
}

#include "support/ChildProcess.h"

#include "support/Require.h"

#include <fcntl.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <cstring>

namespace ost::benchmarks {

namespace {

constexpr int cannotRun = 127;

int execute(std::vector<std::string>& command, const std::string& output) {
    if (!output.empty()) {
        const int file = ::open(output.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
        ::dup2(file, STDOUT_FILENO);
        ::dup2(file, STDERR_FILENO);
    }
    std::vector<char*> arguments;
    for (auto& argument : command)
        arguments.push_back(argument.data());
    arguments.push_back(nullptr);
    ::execvp(arguments[0], arguments.data());
    std::fprintf(stderr, "%s: %s\n", arguments[0], std::strerror(errno));
    return cannotRun;
}

} // namespace

ChildProcess::ChildProcess(const std::function<int()>& body) {
    const pid_t parent = ::getpid();
    _id = ::fork();
    require(_id >= 0, "fork");
    if (_id == 0) {
        ::prctl(PR_SET_PDEATHSIG, SIGTERM);
        ::_exit(::getppid() == parent ? body() : cannotRun);
    }
}

ChildProcess::ChildProcess(std::vector<std::string> command, const std::string& output)
    : ChildProcess([&] { return execute(command, output); }) {}

ChildProcess::~ChildProcess() {
    if (_id == 0)
        return;
    ::kill(_id, SIGTERM);
    wait();
}

bool ChildProcess::hasEnded() {
    siginfo_t info{};
    return _id == 0 ||
           (::waitid(P_PID, static_cast<id_t>(_id), &info, WEXITED | WNOHANG | WNOWAIT) == 0 && info.si_pid == _id);
}

int ChildProcess::wait() {
    int status = 0;
    while (::waitpid(_id, &status, 0) < 0 && errno == EINTR)
        continue;
    _id = 0;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

} // namespace ost::benchmarks

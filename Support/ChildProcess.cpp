#include "Support/ChildProcess.h"

#include <fcntl.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdlib>
#include <system_error>

namespace ost::test {

using platform::FileDescriptor;

namespace {

constexpr int cannotRun = 127;

void require(int error, const char* what) {
    if (error != 0)
        throw std::system_error(error, std::generic_category(), what);
}

struct Pipe {
    FileDescriptor reading, writing;

    Pipe() {
        std::array<int, 2> ends{};
        require(::pipe2(ends.data(), O_CLOEXEC) == 0 ? 0 : errno, "pipe");
        reading.reset(ends[0]);
        writing.reset(ends[1]);
    }
};

/// What `body` throws must not unwind into the copy of the caller.
[[noreturn]] void runAndExit(pid_t parent, const std::function<int()>& body) noexcept {
    ::prctl(PR_SET_PDEATHSIG, SIGTERM);
    ::_exit(::getppid() == parent ? body() : cannotRun);
}

pid_t start(const std::function<int()>& body) {
    const pid_t parent = ::getpid();
    const pid_t child = ::fork();
    require(child >= 0 ? 0 : errno, "fork");
    if (child == 0)
        runAndExit(parent, body);
    return child;
}

bool appendErrorsTo(const char* file) {
    const int errors = ::open(file, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
    return errors >= 0 && ::dup2(errors, STDERR_FILENO) >= 0;
}

std::vector<char*> pointersTo(std::vector<std::string>& words) {
    std::vector<char*> pointers;
    for (std::string& word : words)
        pointers.push_back(word.data());
    pointers.push_back(nullptr);
    return pointers;
}

} // namespace

ChildProcess::ChildProcess(const std::function<int()>& body) : _id(start(body)) {}

ChildProcess::ChildProcess(std::vector<std::string> commandLine, const std::filesystem::path& errorFile) {
    Pipe input;
    Pipe output;
    Pipe failure; // carries the reason why the program could not be run; closed by the one that runs
    const auto arguments = pointersTo(commandLine);
    _id = start([&] {
        // No memory is allocated here: another thread may have held the lock for that.
        if (::dup2(input.reading.get(), STDIN_FILENO) >= 0 && ::dup2(output.writing.get(), STDOUT_FILENO) >= 0 &&
            (errorFile.empty() || appendErrorsTo(errorFile.c_str())))
            ::execvp(arguments[0], arguments.data());
        const int reason = errno;
        return ::write(failure.writing.get(), &reason, sizeof reason) < 0 ? EXIT_FAILURE : cannotRun;
    });
    failure.writing.reset();
    if (int reason = 0; ::read(failure.reading.get(), &reason, sizeof reason) == sizeof reason) {
        wait();
        require(reason, arguments[0]);
    }
    _input = std::move(input.writing);
    _output = std::move(output.reading);
}

ChildProcess::~ChildProcess() {
    if (_id == 0)
        return;
    signal(SIGKILL);
    wait();
}

std::string ChildProcess::readLine() {
    std::string line;
    for (char next = 0; ::read(_output.get(), &next, 1) == 1 && next != '\n';)
        line += next;
    return line;
}

std::string ChildProcess::readAll() {
    std::string text;
    std::array<char, 4096> part{};
    for (ssize_t count = 0; (count = ::read(_output.get(), part.data(), part.size())) > 0;)
        text.append(part.data(), static_cast<std::size_t>(count));
    return text;
}

int ChildProcess::wait() {
    int status = 0;
    while (::waitpid(_id, &status, 0) < 0)
        require(errno == EINTR ? 0 : errno, "wait");
    _id = 0;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

} // namespace ost::test

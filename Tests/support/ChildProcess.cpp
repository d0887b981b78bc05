#include "support/ChildProcess.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <system_error>

namespace ost::test {

using platform::FileDescriptor;

namespace {

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

struct SpawnActions {
    posix_spawn_file_actions_t actions{};

    SpawnActions() { require(::posix_spawn_file_actions_init(&actions), "spawn"); }
    SpawnActions(const SpawnActions&) = delete;
    SpawnActions& operator=(const SpawnActions&) = delete;
    ~SpawnActions() { ::posix_spawn_file_actions_destroy(&actions); }
};

} // namespace

ChildProcess::ChildProcess(std::vector<std::string> commandLine, const std::filesystem::path& errorFile) {
    Pipe input;
    Pipe output;
    SpawnActions spawn;
    ::posix_spawn_file_actions_adddup2(&spawn.actions, input.reading.get(), STDIN_FILENO);
    ::posix_spawn_file_actions_adddup2(&spawn.actions, output.writing.get(), STDOUT_FILENO);
    ::posix_spawn_file_actions_addopen(&spawn.actions, STDERR_FILENO, errorFile.c_str(), O_WRONLY | O_CREAT | O_APPEND,
                                       0600);
    std::vector<char*> arguments;
    for (std::string& argument : commandLine)
        arguments.push_back(argument.data());
    arguments.push_back(nullptr);
    require(::posix_spawnp(&_id, arguments[0], &spawn.actions, nullptr, arguments.data(), environ), arguments[0]);
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

#pragma once

#include "platform/base/FileDescriptor.h"

#include <sys/types.h>

#include <csignal>
#include <filesystem>
#include <functional>
#include <string>
#include <vector>

namespace ost::test {

/// A process that is ended by force, if need be, when the object goes. When this process ends first, however that
/// happens, the kernel sends it SIGTERM. Failures of the system are thrown.
///
/// Threads: the thread that starts the process must outlive it, because that is what the kernel follows.
class ChildProcess {
public:
    /// Runs `body` in a copy of this process; what it returns is the exit status. The copy keeps every descriptor open.
    explicit ChildProcess(const std::function<int()>& body);
    /// Runs a program, found in PATH unless it is a path, with pipes for its standard input and output. Its standard
    /// error is appended to a file where one is named, else it is this process's.
    explicit ChildProcess(std::vector<std::string> commandLine, const std::filesystem::path& errorFile = {});
    ChildProcess(const ChildProcess&) = delete;
    ChildProcess& operator=(const ChildProcess&) = delete;
    ~ChildProcess();

    [[nodiscard]] pid_t id() const { return _id; }

    /// The next line of a program's output without the line end; shorter at the end of the output.
    std::string readLine();

    /// The rest of a program's output, to the end.
    std::string readAll();

    void closeInput() { _input.reset(); }
    void signal(int number) const { ::kill(_id, number); }

    /// Waits for its end: the exit status, or 128 and the number of the signal that ended it.
    int wait();

private:
    platform::FileDescriptor _input, _output;
    pid_t _id = 0; ///< 0 once it has been waited for
};

} // namespace ost::test

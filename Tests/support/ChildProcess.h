#pragma once

#include "platform/base/FileDescriptor.h"

#include <sys/types.h>

#include <csignal>
#include <filesystem>
#include <string>
#include <vector>

namespace ost::test {

/// A program, found in PATH unless it is a path, started by a test with pipes for its standard input and output and a
/// file for its standard error. Ended by force, if need be, when the object goes. Failures of the system are thrown.
class ChildProcess {
public:
    ChildProcess(std::vector<std::string> commandLine, const std::filesystem::path& errorFile);
    ChildProcess(const ChildProcess&) = delete;
    ChildProcess& operator=(const ChildProcess&) = delete;
    ~ChildProcess();

    [[nodiscard]] pid_t id() const { return _id; }

    /// The next line of its output without the line end; shorter at the end of the output.
    std::string readLine();

    /// The rest of its output, to the end.
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

#pragma once

#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

namespace ost::benchmarks {

/// A process that ends with this object, and with the benchmark, however that ends: the kernel then sends it SIGTERM.
///
/// Threads: the main thread, because what the kernel follows is the thread that starts the process.
class ChildProcess {
public:
    /// Runs `body`; what it returns is the exit status.
    explicit ChildProcess(const std::function<int()>& body);
    /// Runs a program, looked for in PATH. What it prints goes to the file `output` where one is named.
    explicit ChildProcess(std::vector<std::string> command, const std::string& output = {});
    ChildProcess(const ChildProcess&) = delete;
    ChildProcess& operator=(const ChildProcess&) = delete;
    ~ChildProcess();

    [[nodiscard]] pid_t id() const { return _id; }
    [[nodiscard]] bool hasEnded();
    /// Waits until the process ends by itself. Gives its exit status, 128 and more for one that a signal ended.
    int wait();

private:
    pid_t _id = 0; ///< 0 once it has been waited for
};

} // namespace ost::benchmarks

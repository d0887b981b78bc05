#pragma once

#include "Client/Confinement.h"
#include "Client/Program.h"
#include "platform/base/FileDescriptor.h"

#include <sys/types.h>

#include <csignal>
#include <expected>
#include <optional>
#include <string>
#include <vector>

namespace ostrand {

/// What becomes of a new process before it executes its program.
struct Launch {
    Program program;
    std::vector<std::string> arguments;   ///< the program's name first
    std::vector<std::string> environment; ///< "NAME=VALUE"
    uid_t user;
    std::vector<gid_t> groups; ///< the process's own first
    ost::platform::FileDescriptor workingDirectory;
    std::optional<Confinement> confinement;
};

/// What the new process could not do.
struct LaunchFailure {
    std::string doing;
    ost::platform::Errno error;
};

/// A child that is held before its first step, executes a program when it is released, and is waited for. From its
/// making to its end, signals that ask this process for something are for the child.
///
/// The program has the standard streams and the signal mask of this process, no other descriptor, no capability, no way
/// to get one, and no terminal, into which it could type. It is never run when a step fails, nor when this process
/// dies before it is released.
///
/// Threads: the calling process has one. Ownership: owns the child until it has been waited for; the launch must
/// outlive it.
class LaunchedProcess {
public:
    /// Starts the child. Fails with an errno.
    [[nodiscard]] static std::expected<LaunchedProcess, ost::platform::Errno> hold(const Launch& launch);
    LaunchedProcess(LaunchedProcess&& other) noexcept;
    LaunchedProcess& operator=(LaunchedProcess&&) = delete;
    /// A child that is still held ends. The number of a child becomes free here, not before.
    ~LaunchedProcess();

    [[nodiscard]] pid_t id() const { return _id; }

    /// Lets the child execute its program; returns when it does, or has died of a signal.
    [[nodiscard]] std::expected<void, LaunchFailure> release();

    /// Hands signals on until the child has ended. Gives its exit status, or 128 and the number of the signal that
    /// ended it.
    [[nodiscard]] int waitForEnd();

private:
    LaunchedProcess(ost::platform::FileDescriptor channel, pid_t id, const sigset_t& formerMask)
        : _channel(std::move(channel)), _id(id), _formerMask(formerMask) {}
    void _forward(const siginfo_t& signal) const;

    ost::platform::FileDescriptor _channel; ///< to the child until it executes
    pid_t _id;                              ///< 0 once moved from
    sigset_t _formerMask;
};

} // namespace ostrand

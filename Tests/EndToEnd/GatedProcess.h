#pragma once

#include "platform/base/FileDescriptor.h"
#include "support/Sanitized.h"

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <mutex>
#include <string>
#include <thread>

namespace ost::test {

/// What befalls one file-system call of a process.
struct Fault {
    enum class Kind : std::uint8_t {
        none,
        kill,        ///< the process is killed where it would have made the call
        fail,        ///< the call does nothing and fails
        failForGood, ///< and so do all that follow
    };

    Kind kind = Kind::none;
    unsigned call = 0; ///< the first one is 1
    int error = 0;     ///< of a call that fails
};

/// From one call that a fault befalls to the next, in a test that goes through all of them. Each start of a daemon
/// takes long under a sanitizer, which is there for the ways through the code and not for each of the calls.
inline constexpr unsigned toNextCall = isSanitized ? 5 : 1;

/// A call that is about to be made, by a thread that waits meanwhile.
struct GatedCall {
    pid_t thread;
    int number;
    const std::uint64_t* arguments;
};
using GatedCallWatcher = std::function<void(const GatedCall&)>;

/// A child process that makes every file-system call through a gate, where the calls are counted and faults befall
/// them.
///
/// The gate is a seccomp filter whose notifications a thread of this object answers; the process itself runs unchanged,
/// and through the gate go the calls of all its threads, one at a time. Calls on descriptors that are no files, and on
/// the standard ones, are let through uncounted.
///
/// Threads: one, and no other may run when the object is made, since it forks. The process is killed with the object.
/// Requires root. Failures of the system are thrown.
class GatedProcess {
public:
    /// Runs `body`, whose result is the exit status, in a child. `fault` is the first one. `watcher` is told of each
    /// call that a fault does not befall, on a thread of this object.
    explicit GatedProcess(const std::function<int()>& body, const Fault& fault = {}, GatedCallWatcher watcher = {});
    GatedProcess(const GatedProcess&) = delete;
    GatedProcess& operator=(const GatedProcess&) = delete;
    ~GatedProcess();

    [[nodiscard]] pid_t id() const { return _id; }
    /// A descriptor that is readable once the process has ended.
    [[nodiscard]] int handle() const { return _process.get(); }

    /// Counts the calls from now on and prepares a fault for one of them.
    void prepare(const Fault& fault);

    /// What the process did since the last fault was prepared.
    struct Course {
        unsigned calls = 0;
        std::string faultedCall; ///< the name of the call that the fault befell, empty when it came to none
    };
    /// Ends the counting and the fault; the process goes on undisturbed.
    Course conclude();

    void kill() const;
    /// Waits for the end of the process: the exit status, or 128 and the number of the signal that ended it.
    int wait();

private:
    void _watchGate();
    /// Whether the call is made; else, unless the process was killed, the error with which it fails.
    struct Verdict {
        bool pass = true;
        int error = 0;
    };
    [[nodiscard]] Verdict _judge(const GatedCall& made);

    pid_t _id = 0; ///< 0 once it has been waited for
    platform::FileDescriptor _process;
    platform::FileDescriptor _gate;
    const GatedCallWatcher _tell;
    std::mutex _mutex; ///< guards the rest
    Fault _fault;
    Course _course;
    std::thread _watcher; ///< uses all of the above
};

} // namespace ost::test

#pragma once

#include "support/Require.h"

#include <sched.h>

#include <cstddef>

namespace ost::benchmarks {

/// Keeps this process, and those that it starts meanwhile, on one processor. Where the system puts a client and a
/// server on two, waking an idle one takes several times as long as all the work that is to be compared, and whether it
/// does changes from server to server.
class OneProcessor {
public:
    OneProcessor() {
        require(::sched_getaffinity(0, sizeof _before, &_before) == 0, "sched_getaffinity");
        cpu_set_t one;
        CPU_ZERO(&one);
        CPU_SET(static_cast<std::size_t>(::sched_getcpu()), &one);
        require(::sched_setaffinity(0, sizeof one, &one) == 0, "sched_setaffinity");
    }
    OneProcessor(const OneProcessor&) = delete;
    OneProcessor& operator=(const OneProcessor&) = delete;
    ~OneProcessor() { ::sched_setaffinity(0, sizeof _before, &_before); }

private:
    cpu_set_t _before{};
};

} // namespace ost::benchmarks

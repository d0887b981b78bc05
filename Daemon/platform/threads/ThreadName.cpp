#include "platform/threads/ThreadName.h"

#include <pthread.h>

namespace ost::platform {

namespace {

constexpr std::size_t kernelNameLimit = 15;

// Not read back from the kernel: there every thread has a name, if only that of the program.
thread_local std::string threadName;

} // namespace

void setCurrentThreadName(std::string_view name) {
    threadName = name;
    const auto dot = name.rfind('.');
    const std::string lastPart(name.substr(dot == std::string_view::npos ? 0 : dot + 1, kernelNameLimit));
    ::pthread_setname_np(::pthread_self(), lastPart.c_str());
}

const std::string& currentThreadName() noexcept { return threadName; }

} // namespace ost::platform

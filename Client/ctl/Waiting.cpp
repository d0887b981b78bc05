#include "Client/ctl/Waiting.h"

#include <cerrno>
#include <cstdio>

namespace ostrand::ctl {

std::expected<void, Failure> waitForReply(Connection& connection, const Result<std::uint32_t>& requestNumber,
                                          const std::function<void()>& report) {
    if (!requestNumber)
        return std::unexpected(Failure::of(requestNumber.error()));
    for (;;) {
        const auto reply = connection.receive(*requestNumber);
        if (reply)
            return {};
        if (reply.error() != Error::transport(ETIMEDOUT))
            return std::unexpected(Failure::of(reply.error()));
        report();
    }
}

std::string secondsSince(std::chrono::steady_clock::time_point begin) {
    const std::chrono::duration<double> passed = std::chrono::steady_clock::now() - begin;
    char seconds[32];
    std::snprintf(seconds, sizeof seconds, "%.3f", passed.count());
    return seconds;
}

} // namespace ostrand::ctl

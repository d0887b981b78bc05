#pragma once

#include <cerrno>
#include <expected>
#include <stdexcept>
#include <string>
#include <system_error>
#include <utility>

namespace ost::benchmarks {

/// Ends the benchmark with errno as the reason when `succeeded` is false.
inline void require(bool succeeded, const std::string& what) {
    if (!succeeded)
        throw std::system_error(errno, std::generic_category(), what);
}

/// The value of a result; ends the benchmark when there is none.
template<typename Value, typename Error>
Value require(std::expected<Value, Error> result, const std::string& what) {
    if (!result) {
        if constexpr (requires { result.error().description(); })
            throw std::runtime_error(what + ": " + result.error().description());
        else
            throw std::system_error(result.error(), std::generic_category(), what);
    }
    if constexpr (!std::is_void_v<Value>)
        return *std::move(result);
}

} // namespace ost::benchmarks

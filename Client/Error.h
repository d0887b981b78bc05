#pragma once

#include <cstdint>
#include <expected>
#include <string>

namespace ostrand {

/// Why an operation of the library gave no result. A value.
struct Error {
    enum class Kind : std::uint8_t {
        refused,   ///< the daemon closed the connection: the caller may not make the request, or the daemon cannot read
                   ///< it
        failed,    ///< the daemon carried the request out and it failed; `code` is its answer
        transport, ///< the daemon could not be reached or understood; `code` is an errno
    };

    Kind kind;
    std::uint64_t code = 0; ///< 0 when refused

    [[nodiscard]] static Error refused() { return {Kind::refused, 0}; }
    [[nodiscard]] static Error failed(std::uint64_t code) { return {Kind::failed, code}; }
    [[nodiscard]] static Error transport(int errnoValue) {
        return {Kind::transport, static_cast<std::uint64_t>(errnoValue)};
    }

    /// The error in words, the number included.
    [[nodiscard]] std::string description() const;

    friend bool operator==(const Error&, const Error&) = default;
};

template<typename T>
using Result = std::expected<T, Error>;

} // namespace ostrand

#pragma once

#include "platform/base/Errno.h"

#include <sys/random.h>

#include <array>
#include <cerrno>
#include <cstdint>
#include <expected>
#include <string>
#include <string_view>

namespace ost {

/// Names tried before giving up; a second is needed about never.
inline constexpr int OSTUniqueNameAttempts = 100;

/// What the name of an unfinished item begins with, so that no listing shows it.
inline constexpr std::string_view OSTUnfinishedPrefix = ".temp.";
/// The same for what this process makes, and so is not a leftover.
[[nodiscard]] const std::string& OSTOwnUnfinishedPrefix();

/// Calls `make` with names of the prefix and six random letters or digits until it answers true, and returns the name
/// that it took. Fails with errno as soon as that is not EEXIST.
template<typename Make>
[[nodiscard]] std::expected<std::string, platform::Errno> OSTMakeUnderUniqueName(std::string_view prefix, Make make) {
    static constexpr std::string_view characters = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789";
    for (int attempt = 0; attempt < OSTUniqueNameAttempts; ++attempt) {
        std::array<std::uint8_t, 6> random{};
        if (::getrandom(random.data(), random.size(), 0) != static_cast<ssize_t>(random.size()))
            return std::unexpected(errno);
        std::string name(prefix);
        for (const auto byte : random)
            name += characters[byte % characters.size()];
        if (make(name.c_str()))
            return name;
        if (errno != EEXIST)
            return std::unexpected(errno);
    }
    return std::unexpected(EEXIST);
}

} // namespace ost

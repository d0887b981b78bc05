#pragma once

#include <array>
#include <compare>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace ost::platform {

/// A universally unique identifier: 16 bytes in the order they are written. A value type; all zero when default-made.
class UUID {
public:
    static constexpr std::size_t size = 16;
    using Bytes = std::array<std::uint8_t, size>;

    constexpr UUID() = default;
    constexpr explicit UUID(const Bytes& bytes) : _bytes(bytes) {}

    /// A new random UUID (version 4). Waits for nothing once the system has booted.
    [[nodiscard]] static UUID generate();

    /// Reads the canonical form, 8-4-4-4-12 hexadecimal digits of either letter case; absent for anything else.
    [[nodiscard]] static std::optional<UUID> parse(std::string_view text);

    /// Takes 16 raw bytes; absent for any other number of them.
    [[nodiscard]] static std::optional<UUID> fromBytes(std::string_view bytes);

    /// The canonical form in upper case.
    [[nodiscard]] std::string string() const;
    [[nodiscard]] std::string description() const { return string(); }

    [[nodiscard]] constexpr const Bytes& bytes() const { return _bytes; }
    [[nodiscard]] std::string_view view() const { return {reinterpret_cast<const char*>(_bytes.data()), size}; }

    friend constexpr auto operator<=>(const UUID&, const UUID&) = default;

private:
    Bytes _bytes{};
};

} // namespace ost::platform

template<>
struct std::hash<ost::platform::UUID> {
    std::size_t operator()(const ost::platform::UUID& uuid) const noexcept {
        return std::hash<std::string_view>{}(uuid.view());
    }
};

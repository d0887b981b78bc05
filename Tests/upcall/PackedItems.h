#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

/// Items of a pack buffer, put together and taken apart by hand.
namespace ost::test::items {

inline std::string header(std::uint16_t type, std::uint16_t value, std::uint32_t numberOrLength) {
    std::string bytes(8, '\0');
    std::memcpy(bytes.data(), &type, sizeof type);
    std::memcpy(bytes.data() + 2, &value, sizeof value);
    std::memcpy(bytes.data() + 4, &numberOrLength, sizeof numberOrLength);
    return bytes;
}

inline const std::string end(8, '\0');

inline std::string number(std::uint16_t value, std::uint32_t number) { return header(1, value, number); }

inline std::string string(std::uint16_t value, std::string_view text) {
    std::string data(text);
    data += '\0';
    const auto length = static_cast<std::uint32_t>(data.size());
    data.resize((data.size() + 7) / 8 * 8);
    return header(2, value, length) + data;
}

/// The items as "value type=content", without the end; "?" where there is something else.
inline std::vector<std::string> shown(std::string_view buffer) {
    std::vector<std::string> items;
    while (buffer.size() >= 8) {
        std::uint16_t type = 0;
        std::uint16_t value = 0;
        std::uint32_t number = 0;
        std::memcpy(&type, buffer.data(), sizeof type);
        std::memcpy(&value, buffer.data() + 2, sizeof value);
        std::memcpy(&number, buffer.data() + 4, sizeof number);
        buffer.remove_prefix(8);
        if (type == 0)
            break;
        if (type == 1) {
            items.push_back(std::to_string(value) + "=" + std::to_string(number));
            continue;
        }
        const auto padded = (std::size_t{number} + 7) / 8 * 8;
        if (type != 2 || number == 0 || padded > buffer.size() || buffer[number - 1] != '\0')
            return {"?"};
        items.push_back(std::to_string(value) + "=" + std::string(buffer.substr(0, number - 1)));
        buffer.remove_prefix(padded);
    }
    if (!buffer.empty())
        items.push_back("?");
    return items;
}

} // namespace ost::test::items

#include "platform/base/FileName.h"

#include <charconv>

namespace ost::platform {

std::string fileNameForKey(std::string_view key) {
    constexpr std::string_view plain = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789._-";
    constexpr char digits[] = "0123456789ABCDEF";
    std::string name;
    for (const char c : key) {
        if (plain.contains(c) && !(c == '.' && name.empty())) {
            name += c;
            continue;
        }
        const auto byte = static_cast<unsigned char>(c);
        name.append({'%', digits[byte >> 4U], digits[byte & 15U]});
    }
    return name;
}

std::optional<std::string> keyOfFileName(std::string_view name) {
    std::string key;
    for (auto rest = name; !rest.empty();) {
        const bool isEscaped = rest.front() == '%' && rest.size() >= 3;
        unsigned byte = static_cast<unsigned char>(rest.front());
        if (isEscaped)
            std::from_chars(rest.data() + 1, rest.data() + 3, byte, 16);
        key += static_cast<char>(byte);
        rest.remove_prefix(isEscaped ? 3 : 1);
    }
    return fileNameForKey(key) == name ? std::optional(key) : std::nullopt;
}

} // namespace ost::platform

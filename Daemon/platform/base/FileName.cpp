#include "platform/base/FileName.h"

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

} // namespace ost::platform

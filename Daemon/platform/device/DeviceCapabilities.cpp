#include "platform/device/DeviceCapabilities.h"

#include "platform/base/SmallFile.h"
#include "platform/base/Text.h"

#include <algorithm>

namespace ost::platform {

namespace {

constexpr std::size_t fileLimit = 1 << 20; // both files are a few lines in practice

/// The value of the last line `name=value`: these are files of shell assignments, where the last one counts.
std::optional<std::string> assignedValue(const char* file, std::string_view name) {
    const auto content = readSmallFile(file, fileLimit, FinalLink::follow);
    if (!content)
        return std::nullopt;
    std::optional<std::string> value;
    for (std::string_view rest = *content; !rest.empty();) {
        const auto line = takeUntil(rest, '\n');
        if (line.starts_with(name) && line.substr(name.size()).starts_with('='))
            value = line.substr(name.size() + 1);
    }
    return value;
}

/// A value without its shell quotes. Between double quotes a backslash stands before a character that would mean
/// something.
std::string unquoted(std::string_view text) {
    const char quote = text.empty() ? '\0' : text.front();
    if ((quote != '"' && quote != '\'') || text.size() < 2 || text.back() != quote)
        return std::string(text);
    text = text.substr(1, text.size() - 2);
    std::string value;
    for (std::size_t index = 0; index < text.size(); ++index) {
        if (quote == '"' && text[index] == '\\' && index + 1 < text.size())
            ++index;
        value += text[index];
    }
    return value;
}

} // namespace

bool deviceCapability(std::string_view name) { return assignedValue("/etc/device-capabilities", name) == "true"; }

std::optional<std::string> buildVersion() {
    auto value = assignedValue("/etc/os-release", "BUILD_ID");
    if (!value)
        return std::nullopt;
    return unquoted(*value);
}

} // namespace ost::platform

#include "Client/ctl/LogLine.h"

#include <strings.h>

#include <algorithm>
#include <array>
#include <cctype>

namespace ostrand::ctl {

namespace {

constexpr std::array levels{LogLevel::error, LogLevel::notice, LogLevel::debug};

/// Takes what stands before `end` from the front of a text, and `end` with it.
std::optional<std::string_view> takeUntil(std::string_view& text, std::string_view end) {
    const auto at = text.find(end);
    if (at == text.npos)
        return std::nullopt;
    const auto taken = text.substr(0, at);
    text.remove_prefix(at + end.size());
    return taken;
}

} // namespace

std::vector<std::string> logLevelNames() {
    std::vector<std::string> names;
    for (const auto level : levels) {
        std::string name = ost::platform::nameOfLogLevel(level);
        std::ranges::transform(name, name.begin(), [](unsigned char letter) { return std::tolower(letter); });
        names.push_back(std::move(name));
    }
    return names;
}

std::optional<LogLevel> logLevelNamed(std::string_view name) {
    for (const auto level : levels) {
        const std::string_view known = ost::platform::nameOfLogLevel(level);
        if (known.size() == name.size() && strncasecmp(known.data(), name.data(), name.size()) == 0)
            return level;
    }
    return std::nullopt;
}

LogLine LogLine::parse(std::string text) {
    LogLine line{.text = std::move(text), .time = {}, .thread = {}, .message = {}};
    std::string_view rest = line.text;
    const auto time = takeUntil(rest, " <");
    const auto level = time ? takeUntil(rest, "> [") : std::nullopt;
    const auto thread = level ? takeUntil(rest, "] ") : std::nullopt;
    const auto known = thread ? logLevelNamed(*level) : std::nullopt;
    if (!known) {
        line.message = line.text;
        return line;
    }
    line.level = *known;
    line.time = *time;
    line.thread = *thread;
    line.message = rest;
    return line;
}

ost::OSTDictionary LogLine::json() const {
    ost::OSTDictionary json;
    json.set("time", time);
    json.set("level", std::string(ost::platform::nameOfLogLevel(level)));
    json.set("thread", thread);
    json.set("message", message);
    return json;
}

} // namespace ostrand::ctl

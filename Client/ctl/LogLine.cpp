#include "Client/ctl/LogLine.h"

#include <strings.h>

#include <array>

namespace ostrand::ctl {

namespace {

constexpr std::array<std::string_view, 3> names{"Error", "Notice", "Debug"};

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

std::optional<LogLevel> logLevelNamed(std::string_view name) {
    for (std::size_t i = 0; i < names.size(); ++i)
        if (names[i].size() == name.size() && strncasecmp(names[i].data(), name.data(), name.size()) == 0)
            return static_cast<LogLevel>(i);
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
    json.set("level", std::string(names.at(static_cast<std::size_t>(level))));
    json.set("thread", thread);
    json.set("message", message);
    return json;
}

} // namespace ostrand::ctl

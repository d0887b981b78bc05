#include "Client/ctl/Commands.h"
#include "Client/ctl/LogFollower.h"
#include "Client/ctl/LogLine.h"
#include "Client/ctl/Suggestion.h"
#include "Client/ctl/Terminal.h"
#include "platform/base/Text.h"
#include "platform/base/Try.h"

#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <deque>

namespace ostrand::ctl {

namespace {

constexpr Option levelOption{"level", "LEVEL", "error, notice or debug: lines of that level and those that weigh more"};
constexpr Option linesOption{"lines", "N", "how many earlier lines come first; 10 when not given"};
constexpr Option onceOption{"once", "", "print the earlier lines, all unless --lines is given, and end"};

constexpr std::size_t usualLines = 10;

std::expected<LogLevel, Failure> levelOf(const Arguments& arguments) {
    const auto name = arguments.value(levelOption.name);
    if (!name)
        return LogLevel::debug;
    if (const auto level = logLevelNamed(*name))
        return *level;
    return std::unexpected(
        Failure::usage("no level is called \"" + escaped(*name) + "\"" + didYouMean(*name, logLevelNames())));
}

std::expected<std::size_t, Failure> lineCountOf(const Arguments& arguments) {
    const auto text = arguments.value(linesOption.name);
    if (!text)
        return arguments.has(onceOption.name) ? std::string::npos : usualLines;
    const auto number = ost::platform::numberIn<std::uint64_t>(*text);
    if (!number)
        return std::unexpected(Failure::usage("\"" + escaped(*text) + "\" is no number"));
    return static_cast<std::size_t>(*number);
}

Style styleOf(LogLevel level) {
    return level == LogLevel::error ? Style::error : level == LogLevel::debug ? Style::faint : Style::plain;
}

/// Prints lines one by one, each at once.
class LinePrinter {
public:
    explicit LinePrinter(bool asJSON) : _asJSON(asJSON) {}
    std::expected<void, Failure> print(const LogLine& line) const {
        const auto text = (_asJSON ? jsonText(line.json()) : _forPeople(line)) + "\n";
        if (std::fputs(text.c_str(), stdout) < 0 || std::fflush(stdout) != 0)
            return std::unexpected(Failure::system("cannot write to standard output", errno));
        return {};
    }

private:
    static std::string _forPeople(const LogLine& line) {
        return styled(escaped(line.text), styleOf(line.level), STDOUT_FILENO);
    }

    bool _asJSON;
};

Outcome watch(const Arguments& arguments) {
    const auto level = OST_TRY(levelOf(arguments));
    const auto lineCount = OST_TRY(lineCountOf(arguments));
    const LinePrinter printer(arguments.has("json"));
    auto follower = LogFollower::open(deviceDirectory(arguments));
    if (!follower)
        return std::unexpected(Failure::system("cannot open the log of the device", follower.error()));
    std::deque<LogLine> earlier;
    for (auto& line : follower->read())
        if (auto parsed = LogLine::parse(std::move(line)); parsed.level <= level) {
            earlier.push_back(std::move(parsed));
            if (earlier.size() > lineCount)
                earlier.pop_front();
        }
    for (const auto& line : earlier)
        OST_TRY(printer.print(line));
    while (!arguments.has(onceOption.name)) {
        if (const auto waited = follower->wait(); !waited)
            return std::unexpected(Failure::system("cannot follow the log", waited.error()));
        for (auto& line : follower->read())
            if (const auto parsed = LogLine::parse(std::move(line)); parsed.level <= level)
                OST_TRY(printer.print(parsed));
    }
    return Report{.text = {}, .json = {}, .isPrinted = true};
}

} // namespace

std::vector<Command> watchCommands() {
    return {
        {"watch",
         "shows the lines of the daemon's log as they come",
         {},
         {levelOption, linesOption, onceOption},
         "Requires root. Without --once it goes on until it is ended, also when the log begins anew.",
         watch,
         R"({"time": "string", "level": "string", "thread": "string", "message": "string"})"},
    };
}

} // namespace ostrand::ctl

#include "Client/ctl/Terminal.h"

#include <unistd.h>

#include <array>
#include <cstdio>
#include <cstdlib>

namespace ostrand::ctl {

namespace {

bool showsColours(int descriptor) {
    const auto variable = [](const char* name) {
        const char* const value = std::getenv(name);
        return std::string_view(value ? value : "");
    };
    return ::isatty(descriptor) != 0 && variable("NO_COLOR").empty() && variable("TERM") != "dumb";
}

} // namespace

std::string styled(std::string_view text, Style style, int descriptor) {
    static constexpr std::array sequences{"", "\033[1m", "\033[1;31m", "\033[33m", "\033[2m"};
    if (style == Style::plain || !showsColours(descriptor))
        return std::string(text);
    return std::string(sequences.at(static_cast<std::size_t>(style))).append(text).append("\033[0m");
}

ProgressLine::ProgressLine(bool wanted) : _shown(wanted && ::isatty(STDERR_FILENO) != 0) {}

ProgressLine::~ProgressLine() {
    if (_shown)
        std::fputs("\r\033[K", stderr);
}

void ProgressLine::show(std::string_view text) const {
    if (_shown)
        std::fprintf(stderr, "\r\033[K%.*s", static_cast<int>(text.size()), text.data());
}

} // namespace ostrand::ctl

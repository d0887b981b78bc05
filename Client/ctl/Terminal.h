#pragma once

#include <string>
#include <string_view>

namespace ostrand::ctl {

/// What a piece of text is, for people whose terminal shows colours.
enum class Style : unsigned char { plain, strong, error, warning, faint };

/// Text as the stream of that descriptor shows it: in colour on a terminal, unless NO_COLOR has a value or the terminal
/// is a dumb one; else as it stands. The text must be escaped already.
[[nodiscard]] std::string styled(std::string_view text, Style style, int descriptor);

/// One line on standard error that is written anew as work goes on, and removed at its end. Nothing is written unless
/// standard error is a terminal.
class ProgressLine {
public:
    explicit ProgressLine(bool wanted);
    ProgressLine(const ProgressLine&) = delete;
    ProgressLine& operator=(const ProgressLine&) = delete;
    ~ProgressLine();

    [[nodiscard]] bool isShown() const { return _shown; }
    void show(std::string_view text) const;

private:
    const bool _shown;
};

} // namespace ostrand::ctl

// Prints a file that packages install, such as a manual page: its template, with what the programs' own tables say in
// the place of lines such as "@COMMANDS@".

#include "Client/ctl/Commands.h"
#include "Client/ctl/ContainerArguments.h"
#include "Client/ctl/Hints.h"
#include "Device/Help.h"
#include "Device/ImageLayout.h"
#include "Protocol/OSTErrorCode.h"

#include <algorithm>
#include <cctype>
#include <cstdio>
#include <fstream>
#include <iostream>
#include <map>
#include <sstream>

using namespace ostrand::ctl;

namespace {

constexpr std::size_t longestLine = 78;

/// A word as the formatter prints it.
std::string escaped(std::string_view word) {
    std::string out;
    for (const char letter : word)
        out += letter == '\\' ? std::string("\\e") : std::string(1, letter);
    if (word == "--")
        return "\\-\\-"; // not a dash
    return (out.starts_with('.') || out.starts_with('\'') ? "\\&" : "") + out;
}

/// Running text: each sentence begins a line, and no line is long.
std::string prose(std::string_view text) {
    std::istringstream words{std::string(text)};
    std::string out, line;
    for (std::string word; words >> word;) {
        if (line.size() + 1 + word.size() > longestLine) {
            out += line + "\n";
            line.clear();
        }
        line += (line.empty() ? escaped(word) : " " + escaped(word));
        if (word.find_last_of(".!?") == word.size() - 1) {
            out += line + "\n";
            line.clear();
        }
    }
    return line.empty() ? out : out + line + "\n";
}

/// A sentence of a table, which has neither a capital letter nor a full stop.
std::string sentence(std::string_view text) {
    std::string out(text);
    out[0] = static_cast<char>(std::toupper(static_cast<unsigned char>(out[0])));
    return prose(out.ends_with('.') ? out : out + ".");
}

/// The argument of a macro that says what a value is.
std::string argument(std::string_view name) { return name.empty() ? "" : " Ar " + std::string(name); }

std::string flag(std::string_view name) { return "Fl -" + std::string(name); }

std::string optionsList(const std::vector<Option>& options) {
    if (options.empty())
        return {};
    std::string out = ".Bl -tag -width Ds -compact\n";
    for (const auto& option : options)
        out += ".It " + flag(option.name) + argument(option.value) + "\n" + sentence(option.help);
    return out + ".El\n";
}

/// How an option stands in a synopsis.
std::string inSynopsis(const Option& option) {
    const auto spelled = flag(option.name) + argument(option.value);
    return (option.count == Option::Count::required ? "." : ".Op ") + spelled +
           (option.count == Option::Count::repeated ? " ...\n" : "\n");
}

std::string inSynopsis(const Operand& operand) {
    switch (operand.count) {
    case Operand::Count::optional:
        return ".Op Ar " + std::string(operand.name) + "\n";
    case Operand::Count::several:
        return ".Ar " + std::string(operand.name) + " ...\n";
    case Operand::Count::any:
        return ".Op Ar " + std::string(operand.name) + " ...\n";
    case Operand::Count::required:
        break;
    }
    return ".Ar " + std::string(operand.name) + "\n";
}

/// Help of several paragraphs, without what all commands say and the page says once.
std::string details(std::string_view text) {
    std::string out;
    while (!text.empty() && text != classesAndUsers) {
        const auto end = std::min(text.find("\n\n"), text.size());
        out += ".Pp\n" + prose(text.substr(0, end));
        text.remove_prefix(std::min(end + 2, text.size()));
    }
    return out;
}

std::string commandSection(const Command& command) {
    std::string out = ".Ss " + std::string(command.name) + "\n" + sentence(command.summary);
    out += ".Bd -ragged -offset indent\n.Nm\n.Cm " + std::string(command.name) + "\n";
    for (const auto& option : command.options)
        out += inSynopsis(option);
    for (const auto& operand : command.operands)
        out += inSynopsis(operand);
    out += ".Ed\n";
    if (!command.operands.empty() || !command.options.empty())
        out += ".Pp\n";
    if (!command.operands.empty()) {
        out += ".Bl -tag -width Ds -compact\n";
        for (const auto& operand : command.operands)
            out += ".It Ar " + std::string(operand.name) + "\n" + sentence(operand.help);
        out += ".El\n";
    }
    return out + optionsList(command.options) + details(command.details) +
           ".Pp\nWith\n.Fl -json :\n.Bd -ragged -compact\n" + prose(command.json) + ".Ed\n";
}

std::string commands() {
    std::string out;
    for (const auto& command : commandTable().commands)
        out += commandSection(command);
    return out;
}

std::string classes() {
    std::string out = ".Bl -tag -width 10n -compact\n";
    for (std::uint64_t number = 1; number < static_cast<std::uint64_t>(ost::OSTContainerClass::max); ++number) {
        const auto containerClass = static_cast<ost::OSTContainerClass>(number);
        const auto user = ost::usualUserOf(containerClass);
        out += ".It " + std::to_string(number) + "\n" +
               prose(std::string(ost::pathComponentForContainerClass(containerClass)) + ", " +
                     (user == ost::OSTCurrentUserPlaceholder ? "of a user above 500."
                                                             : "of user " + std::to_string(user) + "."));
    }
    return out + ".El\n";
}

std::string codes() {
    std::string out = ".Bl -tag -width 6n -compact\n";
    for (std::uint64_t number = 0; number <= static_cast<std::uint64_t>(ost::OSTErrorCode::corruptPropertyList);
         ++number)
        if (const auto meaning = ost::meaningOf(static_cast<ost::OSTErrorCode>(number)); !meaning.empty()) {
            out += ".It " + std::to_string(number) + "\n" + sentence(meaning);
            if (const auto hint = hintFor(ostrand::Error::failed(number)); !hint.empty())
                out += prose(hint);
        }
    return out + ".El\n";
}

std::string deviceOptions() {
    std::string out = ".Bl -tag -width Ds\n";
    for (const auto& [name, value, text] : ost::device::helpRows)
        out += ".It" + (name.empty() ? "" : " " + flag(name.substr(2))) + argument(value) + "\n" + sentence(text);
    return out + ".El\n";
}

/// Text as the rules for files read it.
std::string ruleText(std::string_view text) {
    std::string out;
    for (const char letter : text)
        out += letter == '\n' ? "\\n" : letter == '%' ? "%%" : std::string(1, letter);
    return out;
}

/// Rules that make a directory the image that the launcher would make of it.
std::string imageRules() {
    const std::string image = OSTRAND_IMAGE_DIR;
    std::ostringstream out;
    const auto rule = [&](const char* type, const std::string& name, unsigned mode, unsigned owner) -> std::ostream& {
        return out << type << ' ' << image << name << ' ' << '0' << std::oct << mode << std::dec << ' ' << owner << ' '
                   << owner << " -";
    };
    rule("d", "", 0755, 0) << '\n';
    for (const auto& [name, mode, owner] : ost::device::imageDirectories)
        rule(std::string_view(name) == ost::device::runDirectory ? "D!" : "d", "/" + std::string(name), mode, owner)
            << '\n';
    for (const auto& [name, content] : ost::device::imageFiles)
        rule("f", "/" + std::string(name), 0644, 0) << ' ' << ruleText(content) << '\n';
    return out.str();
}

const std::map<std::string, std::string (*)()> parts{
    {"@IMAGE_RULES@", imageRules},
    {"@COMMANDS@", commands},
    {"@OPTIONS@", [] { return optionsList(commandTable().options); }},
    {"@CLASSES@", classes},
    {"@CODES@", codes},
    {"@DEVICE_SUMMARY@", [] { return prose(ost::device::helpSummary) + ".Pp\n" + prose(ost::device::helpEnd); }},
    {"@DEVICE_OPTIONS@", deviceOptions},
    {"@DEVICE_EXIT@", [] { return prose(ost::device::helpExitStatus); }},
};

} // namespace

int main(int argc, char** argv) {
    std::ifstream page(argc == 2 ? argv[1] : "");
    if (!page) {
        std::fputs("usage: fill-template TEMPLATE\n", stderr);
        return 2;
    }
    for (std::string line; std::getline(page, line);) {
        const auto part = parts.find(line);
        std::cout << (part == parts.end() ? line + "\n" : part->second());
    }
    return std::cout.flush() ? 0 : 1;
}

#pragma once

#include "Client/ctl/Output.h"

#include <array>
#include <map>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

namespace ostrand::ctl {

/// One option of a command: `--name VALUE` or `--name=VALUE`, or `--name` alone for a flag.
struct Option {
    enum class Count : std::uint8_t { optional, required, repeated };

    std::string_view name;
    std::string_view value; ///< what stands for the value in help; empty for a flag
    std::string_view help;
    Count count = Count::optional;
};

/// One argument without a name.
struct Operand {
    enum class Count : std::uint8_t { optional, required, several, any };

    std::string_view name; ///< "FILE"
    std::string_view help;
    Count count = Count::required; ///< several: one at least; it and any: only the last operand
};

/// What the user typed behind a command, checked against its options and operands.
class Arguments {
public:
    /// The value of an option or operand, when it was given; of a repeated option, the last.
    [[nodiscard]] std::optional<std::string> value(std::string_view name) const;
    /// All values of a repeated option, or of an operand of which there are several, in order.
    [[nodiscard]] std::vector<std::string> values(std::string_view name) const;
    [[nodiscard]] bool has(std::string_view name) const { return _values.contains(name); }

    void add(std::string_view name, std::string value) { _values[std::string(name)].push_back(std::move(value)); }

private:
    std::map<std::string, std::vector<std::string>, std::less<>> _values;
};

/// One row of the command table. Everything that the program accepts and everything that its help says comes from here.
struct Command {
    std::string_view name; ///< one or more words: "create", "device lock"
    std::string_view summary;
    std::vector<Operand> operands;
    std::vector<Option> options;
    std::string_view details; ///< further lines of its help
    Outcome (*run)(const Arguments& arguments);
    /// The form of what it prints with --json: a JSON text with the names of types in the place of values, "?" behind
    /// the keys that may be missing and "*" for any key.
    std::string_view json = {};
};

/// The table as a whole.
struct CommandTable {
    std::string_view program;
    std::string_view summary;
    std::vector<Option> options;      ///< options of every command, accepted before and after its name
    std::string_view exitStatus = {}; ///< the paragraph of the help that explains it
    std::vector<Command> commands;
};

/// A command line that can be run. The command is the table's.
struct Invocation {
    const Command* command;
    Arguments arguments;
};

/// A command line that asks for help.
struct Help {
    std::string text;
};

/// A command line that the table does not accept.
struct UsageError {
    std::string message;
    std::string usage; ///< one line
};

/// Reads the words behind the program's name. `--` ends the options; behind `--help` nothing is read.
[[nodiscard]] std::variant<Invocation, Help, UsageError> parseCommandLine(const CommandTable& table,
                                                                          std::span<const std::string_view> words);

/// The options that a command takes, or all commands where it is null: its own and the common ones.
[[nodiscard]] std::array<std::span<const Option>, 2> optionsOf(const CommandTable& table, const Command* command);
/// The one of that name among them; null when there is none.
[[nodiscard]] const Option* optionNamed(const CommandTable& table, const Command* command, std::string_view name);

/// The names of commands, and of groups of them, with one word more than the group's; sorted. Without a group, first
/// words.
[[nodiscard]] std::vector<std::string> namesBelow(const CommandTable& table, std::string_view group);

/// "usage: ostrandctl create --class C ...", for errors that show only when the values are looked at.
[[nodiscard]] std::string usageLine(const CommandTable& table, const Command& command);

} // namespace ostrand::ctl

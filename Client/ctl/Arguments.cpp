#include "Client/ctl/Arguments.h"

#include "Client/ctl/Suggestion.h"

#include <algorithm>
#include <array>

namespace ostrand::ctl {

namespace {

constexpr Option helpOption{"help", "", "shows this"};

std::string spelled(const Option& option) {
    std::string text = "--" + std::string(option.name);
    if (!option.value.empty())
        text.append(" ").append(option.value);
    return text;
}

std::string inUsage(const Option& option) {
    switch (option.count) {
    case Option::Count::required:
        return spelled(option);
    case Option::Count::optional:
        return "[" + spelled(option) + "]";
    case Option::Count::repeated:
        return "[" + spelled(option) + "]...";
    }
    return {};
}

std::string inUsage(const Operand& operand) {
    const std::string name(operand.name);
    switch (operand.count) {
    case Operand::Count::optional:
        return "[" + name + "]";
    case Operand::Count::required:
        return name;
    case Operand::Count::several:
        return name + "...";
    case Operand::Count::any:
        return "[" + name + "...]";
    }
    return {};
}

bool mayRepeat(const Operand& operand) {
    return operand.count == Operand::Count::several || operand.count == Operand::Count::any;
}

bool mayBeMissing(const Operand& operand) {
    return operand.count == Operand::Count::optional || operand.count == Operand::Count::any;
}

/// What the usage line and the help of every level begin with.
std::string usageOf(const CommandTable& table, std::string_view rest) {
    std::string line = "usage: " + std::string(table.program);
    for (const auto& option : table.options)
        line += " " + inUsage(option);
    return line.append(" ").append(rest);
}

/// Rows of two columns under a heading.
class Columns {
public:
    void add(std::string left, std::string_view right) { _rows.emplace_back(std::move(left), right); }
    [[nodiscard]] std::string text(std::string_view heading) const {
        if (_rows.empty())
            return {};
        std::size_t width = 0;
        for (const auto& [left, right] : _rows)
            width = std::max(width, left.size());
        std::string out = "\n" + std::string(heading) + ":\n";
        for (const auto& [left, right] : _rows)
            out.append("  ").append(left).append(width + 2 - left.size(), ' ').append(right).append("\n");
        return out;
    }

private:
    std::vector<std::pair<std::string, std::string_view>> _rows;
};

bool isBelow(const Command& command, std::string_view group) {
    return group.empty() || (command.name.starts_with(group) && command.name.substr(group.size()).starts_with(' '));
}

std::string optionsText(std::span<const Option> own, std::span<const Option> common) {
    Columns columns;
    for (const auto options : {own, common, std::span(&helpOption, 1)})
        for (const auto& option : options)
            columns.add(spelled(option), option.help);
    return columns.text("options");
}

std::string helpOf(const CommandTable& table, const Command& command) {
    std::string text = usageLine(table, command) + "\n\n" + std::string(command.summary) + "\n";
    if (!command.details.empty())
        text.append("\n").append(command.details).append("\n");
    Columns operands;
    for (const auto& operand : command.operands)
        operands.add(std::string(operand.name), operand.help);
    text += operands.text("arguments") + optionsText(command.options, table.options);
    if (!command.json.empty())
        text.append("\nwith --json:\n  ").append(command.json).append("\n");
    return text;
}

std::string usageOfGroup(const CommandTable& table, std::string_view group) {
    return usageOf(table, group.empty() ? "COMMAND ..." : std::string(group) + " COMMAND ...");
}

std::string helpOfGroup(const CommandTable& table, std::string_view group) {
    Columns commands;
    for (const auto& command : table.commands)
        if (isBelow(command, group))
            commands.add(std::string(command.name), command.summary);
    return usageOfGroup(table, group) + "\n\n" + std::string(table.summary) + "\n" + commands.text("commands") +
           optionsText({}, table.options) + "\n\"" + std::string(table.program) + " COMMAND --help\", or \"" +
           std::string(table.program) + " help COMMAND\", says more about a command.\n" + std::string(table.exitStatus);
}

/// Goes through the words once; knows the command as soon as its last word was seen.
class Parser {
public:
    explicit Parser(const CommandTable& table, std::span<const std::string_view> words)
        : _table(table), _words(words) {}

    std::variant<Invocation, Help, UsageError> parse() {
        bool optionsEnded = false, asksForHelp = false;
        while (!_words.empty()) {
            const auto word = _next();
            if (!optionsEnded && word == "--") {
                optionsEnded = true;
                continue;
            }
            if (!optionsEnded && (word == "--help" || word == "-h"))
                return _help();
            if (!optionsEnded && word == "help" && !_command && _group.empty()) {
                asksForHelp = true;
                continue;
            }
            const bool isOption = !optionsEnded && word.size() > 1 && word.starts_with('-');
            if (auto problem = isOption ? _takeOption(word) : _takeWord(word); !problem.empty())
                return _usageError(std::move(problem));
        }
        if (asksForHelp)
            return _help();
        if (auto problem = _whatIsMissing(); !problem.empty())
            return _usageError(std::move(problem));
        return Invocation{_command, std::move(_arguments)};
    }

private:
    // Each step gives an empty text, or what is wrong.

    std::string _takeOption(std::string_view word) {
        const auto equals = word.find('=');
        const auto* const option =
            word.starts_with("--") ? optionNamed(_table, _command, word.substr(2, equals - 2)) : nullptr;
        if (!option)
            return "unknown option " + escaped(word.substr(0, equals)) +
                   didYouMean(word.substr(0, equals), _optionSpellings());
        const auto name = "--" + std::string(option->name);
        if (option->count != Option::Count::repeated && _arguments.has(option->name))
            return name + " is given twice";
        const bool isFlag = option->value.empty();
        if (isFlag && equals != word.npos)
            return name + " takes no value";
        if (!isFlag && equals == word.npos && _words.empty())
            return name + " needs a value";
        const auto value = isFlag ? std::string_view{} : equals != word.npos ? word.substr(equals + 1) : _next();
        _arguments.add(option->name, std::string(value));
        return {};
    }

    std::string _takeWord(std::string_view word) {
        if (!_command)
            return _takeCommandWord(word);
        if (_operandsSeen == _command->operands.size()) {
            if (_operandsSeen == 0 || !mayRepeat(_command->operands.back()))
                return "unexpected argument \"" + escaped(word) + "\"";
            --_operandsSeen;
        }
        _arguments.add(_command->operands[_operandsSeen++].name, std::string(word));
        return {};
    }

    std::string _takeCommandWord(std::string_view word) {
        const auto name = _group.empty() ? std::string(word) : _group + " " + std::string(word);
        const auto found = std::ranges::find(_table.commands, name, &Command::name);
        if (found != _table.commands.end())
            _command = &*found;
        else if (std::ranges::any_of(_table.commands, [&](const auto& each) { return isBelow(each, name); }))
            _group = name;
        else
            return "unknown command \"" + escaped(name) + "\"" + _suggestion(name);
        return {};
    }

    std::string _suggestion(const std::string& name) const {
        const auto nearest = didYouMean(name, namesBelow(_table, _group));
        return nearest.empty() && !_group.empty() ? _choice() : nearest;
    }

    /// The commands of the group.
    std::string _choice() const {
        std::string text;
        for (const auto& name : namesBelow(_table, _group))
            text.append(text.empty() ? ": " : ", ").append(name);
        return text;
    }

    std::vector<std::string> _optionSpellings() const {
        std::vector<std::string> spellings{"--help"};
        for (const auto options : optionsOf(_table, _command))
            for (const auto& option : options)
                spellings.push_back("--" + std::string(option.name));
        return spellings;
    }

    std::string _whatIsMissing() const {
        if (!_command)
            return _group.empty() ? "no command given" : "\"" + _group + "\" needs a further word" + _choice();
        for (std::size_t i = _operandsSeen; i < _command->operands.size(); ++i)
            if (!mayBeMissing(_command->operands[i]))
                return "missing " + std::string(_command->operands[i].name);
        for (const auto& option : _command->options)
            if (option.count == Option::Count::required && !_arguments.has(option.name))
                return "missing " + spelled(option);
        return {};
    }

    Help _help() const { return {_command ? helpOf(_table, *_command) : helpOfGroup(_table, _group)}; }

    UsageError _usageError(std::string message) const {
        return {std::move(message), _command ? usageLine(_table, *_command) : usageOfGroup(_table, _group)};
    }

    std::string_view _next() {
        const auto word = _words.front();
        _words = _words.subspan(1);
        return word;
    }

    const CommandTable& _table;
    std::span<const std::string_view> _words;
    std::string _group; ///< the words of a command's name that were seen so far
    const Command* _command = nullptr;
    std::size_t _operandsSeen = 0;
    Arguments _arguments;
};

} // namespace

std::optional<std::string> Arguments::value(std::string_view name) const {
    const auto found = _values.find(name);
    return found == _values.end() ? std::nullopt : std::optional(found->second.back());
}

std::vector<std::string> Arguments::values(std::string_view name) const {
    const auto found = _values.find(name);
    return found == _values.end() ? std::vector<std::string>{} : found->second;
}

std::variant<Invocation, Help, UsageError> parseCommandLine(const CommandTable& table,
                                                            std::span<const std::string_view> words) {
    return Parser(table, words).parse();
}

std::array<std::span<const Option>, 2> optionsOf(const CommandTable& table, const Command* command) {
    return {command ? std::span(command->options) : std::span<const Option>{}, table.options};
}

const Option* optionNamed(const CommandTable& table, const Command* command, std::string_view name) {
    for (const auto options : optionsOf(table, command))
        if (const auto found = std::ranges::find(options, name, &Option::name); found != options.end())
            return &*found;
    return nullptr;
}

std::vector<std::string> namesBelow(const CommandTable& table, std::string_view group) {
    std::vector<std::string> names;
    for (const auto& command : table.commands)
        if (isBelow(command, group)) {
            const auto end = command.name.find(' ', group.empty() ? 0 : group.size() + 1);
            names.emplace_back(command.name.substr(0, end));
        }
    std::ranges::sort(names);
    names.erase(std::ranges::unique(names).begin(), names.end());
    return names;
}

std::string usageLine(const CommandTable& table, const Command& command) {
    std::string rest(command.name);
    for (const auto& option : command.options)
        rest += " " + inUsage(option);
    for (const auto& operand : command.operands)
        rest += " " + inUsage(operand);
    return usageOf(table, rest);
}

} // namespace ostrand::ctl

#include "Client/ctl/Completion.h"

#include "Client/ctl/Commands.h"
#include "Client/ctl/LogLine.h"
#include "Client/ctl/Values.h"
#include "platform/device/Accounts.h"

#include <algorithm>

namespace ostrand::ctl {

namespace {

constexpr std::chrono::seconds longestWait{1};

/// Others choose identifiers, and a shell takes what it is given for typed by its user.
bool isHarmless(std::string_view name) {
    return !name.empty() && name.front() != '-' && std::ranges::all_of(name, [](char letter) {
        return (letter >= 'a' && letter <= 'z') || (letter >= 'A' && letter <= 'Z') ||
               (letter >= '0' && letter <= '9') || letter == '.' || letter == '_' || letter == '-';
    });
}

std::vector<std::string> usersOf(const std::string& device) {
    std::vector<std::string> users;
    const auto collect = [&](const ost::platform::Account& account) {
        if (isHarmless(account.name))
            users.push_back(account.name);
        return false;
    };
    (void)ost::platform::accountMatching(collect, device);
    return users;
}

/// The identifiers of the containers that the words before ask about; of applications when they name no class.
std::vector<std::string> identifiersFor(const Arguments& arguments, ContainerClass usualClass) {
    const auto className = arguments.value("container-class") ? "container-class" : "class";
    const auto containerClass = classNamed(arguments.value(className).value_or("")).value_or(usualClass);
    const auto user = userNamed(arguments.value("user").value_or(""), deviceDirectory(arguments));
    auto connection = connectToDevice(arguments, longestWait);
    if (!connection)
        return {};
    const auto listed =
        list(*connection, {containerClass, user.value_or(usualUserOf(containerClass)), {}, arguments.has("transient")});
    std::vector<std::string> identifiers;
    for (const auto& container : listed.value_or(std::vector<ListedContainer>()))
        if (isHarmless(container.identifier))
            identifiers.push_back(container.identifier);
    return identifiers;
}

/// Goes through the words before the last one as far as they make sense.
class Reader {
public:
    Reader(const CommandTable& table, std::span<const std::string_view> words) : _table(table) {
        for (const auto word : words)
            if (!(_pending && word == "=")) // bash makes three words of --name=value
                _take(word);
    }

    [[nodiscard]] std::vector<std::string> candidatesFor(std::string_view begun) const {
        if (_pending)
            return _values(_pending->value);
        if (const auto equals = begun.find('='); !_optionsEnded && begun.starts_with("--") && equals != begun.npos)
            return _valuesBehind(begun.substr(0, equals));
        if (!_optionsEnded && begun.starts_with('-'))
            return _options();
        if (!_command)
            return _commandWords();
        if (_command->operands.empty())
            return {};
        return _values(_command->operands.at(std::min(_operandsSeen, _command->operands.size() - 1)).name);
    }

private:
    void _take(std::string_view word) {
        if (_pending) {
            _arguments.add(_pending->name, std::string(word));
            _pending = nullptr;
        } else if (!_optionsEnded && word == "--") {
            _optionsEnded = true;
        } else if (!_optionsEnded && word.starts_with("--")) {
            _takeOption(word);
        } else if (!_command) {
            _takeCommandWord(word);
        } else {
            ++_operandsSeen;
        }
    }

    void _takeOption(std::string_view word) {
        const auto equals = word.find('=');
        const auto* const option = optionNamed(_table, _command, word.substr(2, equals - 2));
        if (option && !option->value.empty() && equals == word.npos)
            _pending = option;
        else if (option)
            _arguments.add(option->name, std::string(equals == word.npos ? "" : word.substr(equals + 1)));
    }

    void _takeCommandWord(std::string_view word) {
        _group.append(_group.empty() ? "" : " ").append(word);
        const auto found = std::ranges::find(_table.commands, _group, &Command::name);
        if (found != _table.commands.end())
            _command = &*found;
    }

    [[nodiscard]] std::vector<std::string> _options() const {
        std::vector<std::string> spellings{"--help"};
        for (const auto options : optionsOf(_table, _command))
            for (const auto& option : options)
                if (option.count == Option::Count::repeated || !_arguments.has(option.name))
                    spellings.push_back("--" + std::string(option.name));
        return spellings;
    }

    [[nodiscard]] std::vector<std::string> _commandWords() const {
        auto words = namesBelow(_table, _group);
        for (auto& word : words)
            word.erase(0, _group.empty() ? 0 : _group.size() + 1);
        return words;
    }

    [[nodiscard]] std::vector<std::string> _valuesBehind(std::string_view spelling) const {
        const auto* const option = optionNamed(_table, _command, spelling.substr(2));
        auto values = option ? _values(option->value) : std::vector<std::string>();
        if (!values.empty() && values.front().starts_with(':'))
            return {};
        for (auto& value : values)
            value.insert(0, std::string(spelling).append("="));
        return values;
    }

    /// The table's word for a value says what the value is.
    [[nodiscard]] std::vector<std::string> _values(std::string_view name) const {
        if (name == "C")
            return classNames();
        if (name == "U")
            return usersOf(deviceDirectory(_arguments));
        if (name == "ID")
            return identifiersFor(_arguments, ContainerClass::dataApplication);
        if (name == "GROUP")
            return identifiersFor(_arguments, ContainerClass::sharedSystemGroup);
        if (name == "LEVEL")
            return logLevelNames();
        if (name == "true|false")
            return {"true", "false"};
        if (name == "DIR")
            return {":directories"};
        if (name == "PROGRAM")
            return {":programs"};
        if (name == "FILE" || name == "PLIST" || name == "ARGUMENT")
            return {":files"};
        return {};
    }

    const CommandTable& _table;
    Arguments _arguments;
    std::string _group;
    const Command* _command = nullptr;
    const Option* _pending = nullptr; ///< whose value comes next
    bool _optionsEnded = false;
    std::size_t _operandsSeen = 0;
};

} // namespace

std::vector<std::string> completions(const CommandTable& table, std::span<const std::string_view> words) {
    if (words.empty())
        return {};
    if (words.size() > 1 && words.front() == "help")
        words = words.subspan(1);
    const bool isEquals = words.back() == "=";
    const auto begun = isEquals ? std::string_view() : words.back();
    auto candidates = Reader(table, words.first(words.size() - 1)).candidatesFor(begun);
    std::erase_if(candidates,
                  [&](const std::string& each) { return !each.starts_with(':') && !each.starts_with(begun); });
    std::ranges::sort(candidates);
    candidates.erase(std::ranges::unique(candidates).begin(), candidates.end());
    return candidates;
}

} // namespace ostrand::ctl

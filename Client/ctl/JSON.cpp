#include "Client/ctl/JSON.h"

#include "platform/base/Unicode.h"

#include <algorithm>
#include <charconv>
#include <string>

namespace ostrand::ctl {

namespace {

/// Reads a text from its front.
class Parser {
public:
    explicit Parser(std::string_view text) : _rest(text) {}

    std::optional<ost::OSTValue> document() {
        auto value = _value(1);
        _skipBlanks();
        return _rest.empty() ? std::move(value) : std::nullopt;
    }

private:
    using Value = std::optional<ost::OSTValue>;

    /// How deep a value may be to go into a request, which is a level of its own.
    static constexpr unsigned deepest = 63;

    Value _value(unsigned depth) {
        _skipBlanks();
        if (depth > deepest || _rest.empty())
            return std::nullopt;
        if (_take("true"))
            return ost::OSTValue(true);
        if (_take("false"))
            return ost::OSTValue(false);
        if (_take("{"))
            return _dictionary(depth);
        if (_take("["))
            return _array(depth);
        if (_rest.front() != '"')
            return _number();
        auto string = _string();
        return string ? Value(*std::move(string)) : std::nullopt;
    }

    Value _array(unsigned depth) {
        ost::OSTArray array;
        const auto element = [&] {
            auto value = _value(depth + 1);
            if (!value)
                return false;
            array.push_back(*std::move(value));
            return true;
        };
        return _list("]", element) ? Value(std::move(array)) : std::nullopt;
    }

    Value _dictionary(unsigned depth) {
        ost::OSTDictionary dictionary;
        const auto entry = [&] {
            auto key = _string();
            _skipBlanks();
            auto value = key && _take(":") ? _value(depth + 1) : std::nullopt;
            if (!value)
                return false;
            dictionary.set(*std::move(key), *std::move(value));
            return true;
        };
        return _list("}", entry) ? Value(std::move(dictionary)) : std::nullopt;
    }

    /// Reads elements with commas between them up to the end.
    bool _list(std::string_view end, const auto& readElement) {
        _skipBlanks();
        if (_take(end))
            return true;
        do {
            _skipBlanks();
            if (!readElement())
                return false;
            _skipBlanks();
        } while (_take(","));
        return _take(end);
    }

    std::optional<std::string> _string() {
        if (!_take("\""))
            return std::nullopt;
        std::string string;
        while (!_take("\""))
            if (_rest.empty() || !(_take("\\") ? _escape(string) : _character(string)))
                return std::nullopt;
        return string;
    }

    bool _character(std::string& out) {
        const auto character = ost::platform::takeCodePoint(_rest);
        if (!character || *character < 0x20)
            return false;
        ost::platform::appendUTF8(out, *character);
        return true;
    }

    bool _escape(std::string& out) {
        static constexpr std::string_view letters = "\"\\/bfnrt", meanings = "\"\\/\b\f\n\r\t";
        const auto at = _rest.empty() ? letters.npos : letters.find(_rest.front());
        if (at != letters.npos) {
            _rest.remove_prefix(1);
            out += meanings[at];
            return true;
        }
        auto character = _take("u") ? _fourDigits() : std::nullopt;
        if (character && *character >= 0xd800 && *character < 0xdc00) { // the first half of a character
            const auto second = _take("\\u") ? _fourDigits() : std::nullopt;
            if (!second || *second < 0xdc00 || *second > 0xdfff)
                return false;
            character = 0x10000 + ((*character - 0xd800) << 10U) + (*second - 0xdc00);
        }
        if (!character || *character == 0 || (*character >= 0xdc00 && *character < 0xe000))
            return false;
        ost::platform::appendUTF8(out, *character);
        return true;
    }

    std::optional<char32_t> _fourDigits() {
        std::uint32_t number = 0;
        const auto digits = _rest.substr(0, 4);
        const auto [end, error] = std::from_chars(digits.data(), digits.data() + digits.size(), number, 16);
        if (error != std::errc{} || end != digits.data() + 4)
            return std::nullopt;
        _rest.remove_prefix(4);
        return number;
    }

    Value _number() {
        const auto text = _rest.substr(0, _rest.find_first_not_of("+-.eE0123456789"));
        _rest.remove_prefix(text.size());
        if (auto integer = _whole<std::int64_t>(text))
            return integer;
        if (auto integer = _whole<std::uint64_t>(text))
            return integer;
        return text.starts_with('+') || text.starts_with('.') ? std::nullopt : _whole<double>(text);
    }

    template<typename Number>
    static Value _whole(std::string_view text) {
        Number number{};
        const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
        return error == std::errc{} && end == text.data() + text.size() ? Value(number) : std::nullopt;
    }

    void _skipBlanks() { _rest.remove_prefix(std::min(_rest.find_first_not_of(" \t\r\n"), _rest.size())); }

    bool _take(std::string_view token) {
        if (!_rest.starts_with(token))
            return false;
        _rest.remove_prefix(token.size());
        return true;
    }

    std::string_view _rest;
};

} // namespace

std::optional<ost::OSTValue> parseJSON(std::string_view text) { return Parser(text).document(); }

} // namespace ostrand::ctl

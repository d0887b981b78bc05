#include "Client/ctl/InfoValues.h"

#include "Client/ctl/JSON.h"
#include "Client/ctl/Values.h"

#include <charconv>
#include <cmath>
#include <ctime>
#include <optional>

namespace ostrand::ctl {

namespace {

using Value = std::optional<ost::OSTValue>;

template<typename Number>
std::optional<Number> numberIn(std::string_view text, auto... format) {
    Number number{};
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number, format...);
    return error == std::errc{} && end == text.data() + text.size() ? std::optional(number) : std::nullopt;
}

Value integerIn(const std::string& text) {
    if (const auto number = numberIn<std::int64_t>(text))
        return *number;
    const auto number = numberIn<std::uint64_t>(text);
    return number ? Value(*number) : std::nullopt;
}

Value booleanIn(const std::string& text) {
    if (text != "true" && text != "false")
        return std::nullopt;
    return text == "true";
}

Value dataIn(const std::string& text) {
    ost::OSTData data;
    for (std::size_t i = 0; i < text.size(); i += 2) {
        const auto digits = std::string_view(text).substr(i, 2);
        const auto byte = numberIn<std::uint8_t>(digits, 16);
        if (digits.size() != 2 || !byte)
            return std::nullopt;
        data.bytes += static_cast<char>(*byte);
    }
    return data;
}

Value dateIn(const std::string& text) {
    if (const auto seconds = numberIn<double>(text); seconds && std::isfinite(*seconds))
        return ost::OSTDate{*seconds};
    std::tm parts{};
    const char* const end = ::strptime(text.c_str(), "%Y-%m-%dT%H:%M:%SZ", &parts);
    return end && *end == '\0' ? Value(ost::OSTDate{static_cast<double>(::timegm(&parts))}) : std::nullopt;
}

/// What such a text looks like, where that is not plain.
std::string_view formOf(std::string_view type) {
    if (type == "data")
        return "; two hexadecimal digits make a byte";
    if (type == "date")
        return "; write it as 2026-11-22T19:46:01Z, or as seconds since 1970";
    if (type == infoValueOperand.name)
        return "; --string takes a text as it is";
    return {};
}

Value valueIn(std::string_view type, const std::string& text) {
    if (type == "string")
        return text;
    if (type == "integer")
        return integerIn(text);
    if (type == "boolean")
        return booleanIn(text);
    if (type == "data")
        return dataIn(text);
    if (type == "date")
        return dateIn(text);
    return parseJSON(text);
}

} // namespace

std::expected<ost::OSTValue, Failure> infoValueOf(const Arguments& arguments) {
    std::vector<std::string_view> given;
    if (arguments.has(infoValueOperand.name))
        given.push_back(infoValueOperand.name);
    for (const auto& option : infoValueOptions)
        if (arguments.has(option.name))
            given.push_back(option.name);
    if (given.size() != 1)
        return std::unexpected(Failure::usage(given.empty() ? "no value given" : "the value is given twice"));
    const auto type = given.front();
    const auto text = *arguments.value(type);
    if (type == "plist")
        return propertyListIn(text);
    if (auto value = valueIn(type, text))
        return *std::move(value);
    return std::unexpected(
        Failure::usage("\"" + escaped(text) + "\" is no " + std::string(type) + std::string(formOf(type))));
}

} // namespace ostrand::ctl

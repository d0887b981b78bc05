#include "Client/ctl/Output.h"

#include "Client/ctl/Hints.h"
#include "platform/base/MessageFormat.h"
#include "platform/base/Text.h"
#include "platform/base/Unicode.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace ostrand::ctl {

namespace {

constexpr char32_t replacementCharacter = 0xfffd;

void appendNumber(std::string& out, auto number) {
    char digits[32];
    out.append(digits, std::to_chars(std::begin(digits), std::end(digits), number).ptr);
}

void appendString(std::string& out, std::string_view text) {
    out += '"';
    while (!text.empty()) {
        const auto character = ost::platform::takeCodePoint(text).value_or(replacementCharacter);
        if (character == '"' || character == '\\')
            out += '\\';
        if (ost::platform::onlyShowsItself(character)) {
            ost::platform::appendUTF8(out, character);
        } else {
            out += "\\u";
            ost::platform::appendHex(out, static_cast<unsigned char>(character >> 8U));
            ost::platform::appendHex(out, static_cast<unsigned char>(character));
        }
    }
    out += '"';
}

void appendValue(std::string& out, const ost::OSTValue& value);

/// Appends the elements between brackets, separated by commas.
void appendList(std::string& out, std::string_view brackets, const auto& elements, const auto& appendElement) {
    out += brackets[0];
    const auto begin = out.size();
    for (const auto& element : elements) {
        if (out.size() > begin)
            out += ", ";
        appendElement(element);
    }
    out += brackets[1];
}

struct Appender {
    std::string& out;

    void operator()(bool value) const { out += value ? "true" : "false"; }
    void operator()(std::int64_t value) const { appendNumber(out, value); }
    void operator()(std::uint64_t value) const { appendNumber(out, value); }
    void operator()(double value) const {
        if (std::isfinite(value))
            appendNumber(out, value);
        else
            out += "null";
    }
    void operator()(const std::string& value) const { appendString(out, value); }
    void operator()(const ost::OSTDate& value) const { (*this)(value.secondsSince1970); }
    void operator()(const ost::OSTData& value) const {
        out += '"';
        for (const char byte : value.bytes)
            ost::platform::appendHex(out, static_cast<unsigned char>(byte));
        out += '"';
    }
    void operator()(const std::shared_ptr<const ost::OSTArray>& value) const {
        appendList(out, "[]", *value, [&](const auto& element) { appendValue(out, element); });
    }
    void operator()(const std::shared_ptr<const ost::OSTDictionary>& value) const {
        appendList(out, "{}", *value, [&](const auto& entry) {
            appendString(out, entry.first);
            out += ": ";
            appendValue(out, entry.second);
        });
    }
};

void appendValue(std::string& out, const ost::OSTValue& value) { std::visit(Appender{out}, value.variant()); }

/// A value behind its key or dash: on the same line, or as lines of its own below.
void appendTree(std::string& out, const ost::OSTValue& value, std::size_t depth);

void appendIndented(std::string& out, std::string_view text, std::size_t depth) {
    constexpr std::size_t columns = 4;
    out.append(depth * columns, ' ').append(text);
}

void appendTree(std::string& out, const ost::OSTDictionary& dictionary, std::size_t depth) {
    for (const auto& [key, value] : dictionary) {
        appendIndented(out, escaped(key), depth);
        appendTree(out, value, depth);
    }
}

void appendTree(std::string& out, const ost::OSTValue& value, std::size_t depth) {
    const auto* const dictionary = value.asDictionary();
    const auto* const array = value.asArray();
    if (dictionary && !dictionary->empty()) {
        out += '\n';
        appendTree(out, *dictionary, depth + 1);
    } else if (array && !array->empty()) {
        out += '\n';
        for (const auto& element : *array) {
            appendIndented(out, "-", depth + 1);
            appendTree(out, element, depth + 1);
        }
    } else {
        const bool hasWords = value.asData() || value.asDate();
        out += ' ' + (hasWords ? value.description() : jsonText(value)) + '\n';
    }
}

std::string_view nameOf(Error::Kind kind) {
    switch (kind) {
    case Error::Kind::refused:
        return "refused";
    case Error::Kind::failed:
        return "failed";
    case Error::Kind::transport:
        break;
    }
    return "transport";
}

Failure makeFailure(int exitStatus, std::string_view kind, std::uint64_t code, std::string message,
                    std::string hint = {}) {
    ost::OSTDictionary details;
    details.set("kind", std::string(kind));
    if (code != 0)
        details.set("code", code);
    details.set("message", message);
    if (!hint.empty())
        details.set("hint", hint);
    ost::OSTDictionary json;
    json.set("error", std::move(details));
    return {exitStatus, std::move(message), std::move(json), std::move(hint)};
}

/// How many columns of a terminal a text takes, where each character takes one.
std::size_t widthOf(std::string_view text) {
    return static_cast<std::size_t>(
        std::ranges::count_if(text, [](char byte) { return (static_cast<unsigned char>(byte) & 0xc0U) != 0x80; }));
}

} // namespace

Failure Failure::usage(std::string message) {
    auto failure = makeFailure(usageStatus, "usage", 0, std::move(message));
    failure.isUsage = true;
    return failure;
}

Failure Failure::of(const Error& error) {
    return makeFailure(EXIT_FAILURE, nameOf(error.kind), error.code, error.description(), std::string(hintFor(error)));
}

Failure Failure::of(const Error& error, const std::string& message, std::string hint) {
    return makeFailure(EXIT_FAILURE, nameOf(error.kind), error.code,
                       "error " + std::to_string(error.code) + ": " + message, std::move(hint));
}

Failure Failure::local(std::string message) { return makeFailure(EXIT_FAILURE, "local", 0, std::move(message)); }

Failure Failure::system(std::string_view doing, int errnoValue) {
    return makeFailure(EXIT_FAILURE, "local", static_cast<std::uint64_t>(errnoValue),
                       escaped(doing) + ": " + std::strerror(errnoValue));
}

std::string escaped(std::string_view text) {
    std::string out;
    ost::platform::appendEscaped(out, text);
    return out;
}

std::string Table::text() const {
    std::vector<std::size_t> widths;
    for (const auto& row : _rows) {
        widths.resize(std::max(widths.size(), row.size()));
        for (std::size_t i = 0; i < row.size(); ++i)
            widths[i] = std::max(widths[i], widthOf(row[i]));
    }
    std::string out;
    for (const auto& row : _rows) {
        for (std::size_t i = 0; i < row.size(); ++i)
            out.append(row[i]).append(i + 1 < row.size() ? widths[i] + 2 - widthOf(row[i]) : 0, ' ');
        out += '\n';
    }
    return out;
}

std::string sizeText(std::uint64_t bytes, bool exact) {
    constexpr std::array units{"B", "KiB", "MiB", "GiB", "TiB", "PiB", "EiB"};
    auto size = static_cast<double>(bytes);
    std::size_t unit = 0;
    for (; !exact && size >= 1024 && unit + 1 < units.size(); ++unit)
        size /= 1024;
    char text[48];
    if (unit == 0)
        std::snprintf(text, sizeof text, exact ? "%14llu" : "%6llu B  ", static_cast<unsigned long long>(bytes));
    else
        std::snprintf(text, sizeof text, "%6.1f %s", size, units.at(unit));
    return text;
}

std::string countOf(std::uint64_t count, std::string_view thing) {
    return std::to_string(count).append(" ").append(thing).append(count == 1 ? "" : "s");
}

std::string jsonText(const ost::OSTValue& value) {
    std::string out;
    appendValue(out, value);
    return out;
}

std::string treeText(const ost::OSTDictionary& dictionary) {
    std::string out;
    appendTree(out, dictionary, 0);
    return out;
}

} // namespace ostrand::ctl

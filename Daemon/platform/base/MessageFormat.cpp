#include "platform/base/MessageFormat.h"

#include "platform/base/Text.h"
#include "platform/base/Unicode.h"

#include <algorithm>
#include <charconv>

namespace ost::platform {

namespace {

/// The length of the valid UTF-8 sequence at the start of `text` that only shows itself, or 0.
std::size_t printableSequence(std::string_view text) {
    auto rest = text;
    const auto codePoint = takeCodePoint(rest);
    return codePoint && onlyShowsItself(*codePoint) ? text.size() - rest.size() : 0;
}

/// What a message shows of one text: every path and identifier of ordinary length, and not so much that a client could
/// fill the log with a few requests.
constexpr std::size_t longestText = 8192;

/// Appends as much of `text`, escaped, as a message shows.
void appendShown(std::string& out, std::string_view text) {
    const auto begin = out.size();
    appendEscaped(out, text.substr(0, longestText));
    if (out.size() - begin <= longestText && text.size() <= longestText)
        return;
    // Not within a sequence that stands for one character.
    auto end = std::min(out.size(), begin + longestText);
    while (end > begin && (static_cast<unsigned char>(out[end - 1]) & 0xc0) == 0x80)
        --end;
    if (end > begin && static_cast<unsigned char>(out[end - 1]) >= 0xc0)
        --end;
    out.resize(end);
    out += "...";
}

void appendNumber(std::string& out, auto value, int base) {
    char buffer[24];
    const auto end = std::to_chars(std::begin(buffer), std::end(buffer), value, base).ptr;
    out.append(buffer, end);
}

} // namespace

void appendEscaped(std::string& out, std::string_view text) {
    const auto isPlain = [](char c) { return c >= ' ' && c <= '~'; };
    while (!text.empty()) {
        const auto plain = std::ranges::find_if_not(text, isPlain);
        std::size_t length =
            plain != text.begin() ? static_cast<std::size_t>(plain - text.begin()) : printableSequence(text);
        if (length > 0) {
            out.append(text.substr(0, length));
        } else {
            const auto byte = static_cast<unsigned char>(text[0]);
            switch (byte) {
            case '\n':
                out += "\\n";
                break;
            case '\t':
                out += "\\t";
                break;
            case '\r':
                out += "\\r";
                break;
            default:
                out += "\\x";
                appendHex(out, byte);
            }
            length = 1;
        }
        text.remove_prefix(length);
    }
}

MessageArgument::MessageArgument(double value) : _kind(Kind::text), _unsigned(0) {
    char buffer[32];
    const auto end = std::to_chars(std::begin(buffer), std::end(buffer), value).ptr;
    _owned.assign(buffer, end);
    _text = _owned;
}

void MessageArgument::appendTo(std::string& out, char conversion) const {
    const int base = conversion == 'x' || conversion == 'p' ? 16 : conversion == 'o' ? 8 : 10;
    switch (_kind) {
    case Kind::text:
        appendShown(out, _text);
        break;
    case Kind::signedNumber:
        appendNumber(out, _signed, base);
        break;
    case Kind::unsignedNumber:
        appendNumber(out, _unsigned, base);
        break;
    case Kind::error:
        if (const Errno error(static_cast<int>(_signed)); conversion == 'd')
            appendNumber(out, static_cast<int>(error), base);
        else
            appendShown(out, error.description());
        break;
    case Kind::pointer:
        out += "0x";
        appendNumber(out, _unsigned, 16);
        break;
    }
}

std::string formatMessage(std::string_view format, std::initializer_list<const MessageArgument*> arguments) {
    std::string out;
    out.reserve(format.size() + 16 * arguments.size());
    auto argument = arguments.begin();
    for (std::size_t i = 0; i < format.size(); ++i) {
        if (format[i] != '%') {
            out += format[i];
            continue;
        }
        do
            ++i;
        while (format[i] == 'l');
        (*argument++)->appendTo(out, format[i]);
    }
    return out;
}

std::string qualifiedFunctionName(const std::source_location& where) {
    std::string name = where.function_name();
    constexpr std::string_view gccAnonymous = "{anonymous}::";
    constexpr std::string_view clangAnonymous = "(anonymous namespace)::";
    for (const auto prefix : {gccAnonymous, clangAnonymous, std::string_view("ost::"), std::string_view("platform::")})
        for (auto at = name.find(prefix); at != std::string::npos; at = name.find(prefix, at))
            name.erase(at, prefix.size());

    // The arguments begin at the first parenthesis outside template arguments; the result type ends at the last blank
    // before them. What follows (arguments, qualifiers, lambdas) is no part of the name.
    int depth = 0;
    std::size_t begin = 0;
    for (std::size_t i = 0; i < name.size(); ++i) {
        const char c = name[i];
        if (c == '<')
            ++depth;
        else if (c == '>')
            --depth;
        else if (depth == 0 && c == ' ')
            begin = i + 1;
        else if (depth == 0 && c == '(')
            return name.substr(begin, i - begin);
    }
    return name.substr(begin);
}

std::string_view lastPartOfFunctionName(std::string_view qualifiedName) {
    const auto at = qualifiedName.rfind("::");
    return at == std::string_view::npos ? qualifiedName : qualifiedName.substr(at + 2);
}

} // namespace ost::platform

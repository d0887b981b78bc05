#include "platform/codec/XMLScanner.h"

#include "platform/base/Try.h"
#include "platform/base/Unicode.h"

#include <algorithm>
#include <array>
#include <charconv>

namespace ost::platform {

namespace {

constexpr std::string_view byteOrderMark = "\xef\xbb\xbf";

bool looksLikeUTF16(std::string_view document) {
    using namespace std::string_view_literals;
    return std::ranges::any_of(std::to_array({"\xfe\xff"sv, "\xff\xfe"sv, "\0<"sv, "<\0"sv}),
                               [&](std::string_view start) { return document.starts_with(start); });
}

bool isXMLCharacter(char32_t c) {
    if (c < 0x20)
        return isXMLSpace(static_cast<char>(c));
    return c < 0xd800 || (c >= 0xe000 && c < 0xfffe) || (c >= 0x10000 && c <= 0x10ffff);
}

/// Whether `c` is a control character or part of a character outside ASCII.
bool isUnusual(char c) { return static_cast<signed char>(c) < 0x20; }

bool isNameCharacter(char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
           std::string_view("_-.:").find(c) != std::string_view::npos || static_cast<unsigned char>(c) >= 0x80;
}

bool equalIgnoringCase(std::string_view text, std::string_view lowerCase) {
    return std::ranges::equal(text, lowerCase,
                              [](char a, char b) { return (a >= 'A' && a <= 'Z' ? a - 'A' + 'a' : a) == b; });
}

/// The character that a reference stands for, without its ampersand and semicolon.
std::optional<char32_t> characterForReference(std::string_view name) {
    constexpr std::pair<std::string_view, char32_t> entities[] = {
        {"lt", U'<'}, {"gt", U'>'}, {"amp", U'&'}, {"quot", U'"'}, {"apos", U'\''}};
    for (const auto& [entity, character] : entities)
        if (name == entity)
            return character;
    if (!name.starts_with('#'))
        return std::nullopt;
    const bool isHexadecimal = name.starts_with("#x");
    name.remove_prefix(isHexadecimal ? 2 : 1);
    std::uint32_t number = 0;
    const auto end = name.data() + name.size();
    const auto parsed = std::from_chars(name.data(), end, number, isHexadecimal ? 16 : 10);
    if (parsed.ec != std::errc() || parsed.ptr != end || !isXMLCharacter(number))
        return std::nullopt;
    return char32_t{number};
}

} // namespace

std::unexpected<PropertyListError> XMLScanner::malformed(std::string_view what) const {
    const auto line = 1 + std::ranges::count(_document.substr(0, _position), '\n');
    std::string reason = "Malformed XML property list: line ";
    reason.append(std::to_string(line)).append(": ").append(what);
    return std::unexpected(PropertyListError{std::move(reason)});
}

XMLScanner::Result<void> XMLScanner::readProlog() {
    if (looksLikeUTF16(_document))
        return malformed("UTF-16 is not supported");
    if (_rest().starts_with(byteOrderMark))
        _position += byteOrderMark.size();
    const auto first = std::ranges::find_if_not(_rest(), isXMLSpace);
    if (first == _document.end() || *first != '<')
        return std::unexpected(PropertyListError{"Neither a binary nor an XML property list"});
    OST_TRY(_checkCharacters());
    if (_rest().starts_with("<?xml") && _rest().size() > 5 && isXMLSpace(_rest()[5]))
        OST_TRY(_readDeclaration());
    OST_TRY(_skipMiscellaneous());
    if (_take("<!DOCTYPE"))
        OST_TRY(_skipDocumentType());
    return {};
}

XMLScanner::Result<std::optional<XMLScanner::Tag>> XMLScanner::nextTag() {
    OST_TRY(_skipMiscellaneous());
    if (_rest().empty())
        return std::nullopt;
    if (_take("</")) {
        const auto name = OST_TRY(_name());
        _skipSpace();
        if (!_take(">"))
            return malformed("closing tag without an end");
        return Tag{Tag::Kind::closing, name};
    }
    if (!_take("<"))
        return malformed("text outside an element that may hold it");
    const auto name = OST_TRY(_name());
    return Tag{OST_TRY(_restOfOpeningTag()), name};
}

XMLScanner::Result<std::string> XMLScanner::textUntilClosing(std::string_view name) {
    std::string text;
    for (;;) {
        const auto characters = _rest().substr(0, _rest().find_first_of("<&"));
        _appendCharacters(text, characters);
        _position += characters.size();
        if (_rest().starts_with("</"))
            break;
        OST_TRY(_appendMarkup(text));
    }
    const auto tag = OST_TRY(nextTag());
    if (tag->name != name)
        return malformed("closing tag of another element");
    return text;
}

bool XMLScanner::_take(std::string_view expected) {
    const bool matches = _rest().starts_with(expected);
    if (matches)
        _position += expected.size();
    return matches;
}

bool XMLScanner::_skipSpace() {
    const auto before = _position;
    while (_position < _document.size() && isXMLSpace(_document[_position]))
        ++_position;
    return _position > before;
}

XMLScanner::Result<void> XMLScanner::_skipPast(std::string_view end) {
    const auto at = _document.find(end, _position);
    if (at == std::string_view::npos)
        return malformed(std::string(end) + " is missing");
    _position = at + end.size();
    return {};
}

XMLScanner::Result<bool> XMLScanner::_skipCommentOrInstruction() {
    if (_take("<?")) {
        OST_TRY(_skipPast("?>"));
        return true;
    }
    if (!_take("<!--"))
        return false;
    OST_TRY(_skipPast("--"));
    if (!_take(">"))
        return malformed("\"--\" in a comment");
    return true;
}

XMLScanner::Result<void> XMLScanner::_skipMiscellaneous() {
    do
        _skipSpace();
    while (OST_TRY(_skipCommentOrInstruction()));
    return {};
}

XMLScanner::Result<void> XMLScanner::_checkCharacters() {
    while (!_rest().empty()) {
        const auto plain = std::ranges::find_if(_rest(), isUnusual);
        _position = static_cast<std::size_t>(plain - _document.begin());
        if (_rest().empty())
            break;
        auto rest = _rest();
        const auto character = takeCodePoint(rest);
        if (!character)
            return malformed("text that is not UTF-8");
        if (!isXMLCharacter(*character))
            return malformed("forbidden character");
        _position = _document.size() - rest.size();
    }
    _position = _document.starts_with(byteOrderMark) ? byteOrderMark.size() : 0;
    return {};
}

XMLScanner::Result<void> XMLScanner::_readDeclaration() {
    _position += std::string_view("<?xml").size();
    while (_skipSpace() && !_rest().starts_with("?>")) {
        const auto name = OST_TRY(_name());
        const auto value = OST_TRY(_quoted());
        if (name == "encoding" && !equalIgnoringCase(value, "utf-8") && !equalIgnoringCase(value, "us-ascii"))
            return malformed("encoding other than UTF-8");
    }
    if (!_take("?>"))
        return malformed("bad XML declaration");
    return {};
}

XMLScanner::Result<void> XMLScanner::_skipDocumentType() {
    for (;;) {
        const auto at = _document.find_first_of("\"'[>", _position);
        if (at == std::string_view::npos)
            return malformed("document type without an end");
        _position = at + 1;
        const char found = _document[at];
        if (found == '>')
            return {};
        if (found == '[')
            return malformed("document type with declarations of its own");
        OST_TRY(_skipPast(std::string_view(&found, 1)));
    }
}

XMLScanner::Result<std::string_view> XMLScanner::_name() {
    const auto end = std::ranges::find_if_not(_rest(), isNameCharacter);
    const auto name = _rest().substr(0, static_cast<std::size_t>(end - _rest().begin()));
    if (name.empty())
        return malformed("no name where one is due");
    _position += name.size();
    return name;
}

/// The value of an attribute, from its equals sign on.
XMLScanner::Result<std::string_view> XMLScanner::_quoted() {
    _skipSpace();
    const bool hasEqualsSign = _take("=");
    _skipSpace();
    if (!hasEqualsSign || _rest().empty() || (_rest()[0] != '"' && _rest()[0] != '\''))
        return malformed("attribute without a value");
    const auto end = _rest().find(_rest()[0], 1);
    const auto value = _rest().substr(1, end - 1);
    if (end == std::string_view::npos || value.find('<') != std::string_view::npos)
        return malformed("bad attribute value");
    _position += end + 1;
    return value;
}

XMLScanner::Result<XMLScanner::Tag::Kind> XMLScanner::_restOfOpeningTag() {
    for (;;) {
        const bool isSeparated = _skipSpace();
        if (_take(">"))
            return Tag::Kind::opening;
        if (_take("/>"))
            return Tag::Kind::empty;
        if (!isSeparated)
            return malformed("bad tag");
        OST_TRY(_name());
        OST_TRY(_quoted());
    }
}

/// What in a text is neither a character nor a closing tag.
XMLScanner::Result<void> XMLScanner::_appendMarkup(std::string& text) {
    if (_take("&"))
        return _appendReference(text);
    if (_take("<![CDATA[")) {
        const auto begin = _position;
        OST_TRY(_skipPast("]]>"));
        _appendCharacters(text, _document.substr(begin, _position - 3 - begin));
        return {};
    }
    if (!OST_TRY(_skipCommentOrInstruction()))
        return malformed(_rest().empty() ? "text without an end" : "element inside a text");
    return {};
}

XMLScanner::Result<void> XMLScanner::_appendReference(std::string& text) {
    const auto name = _rest().substr(0, _rest().find(';'));
    const auto character = characterForReference(name);
    if (!character || name.size() == _rest().size())
        return malformed("reference to an unknown entity or character");
    appendUTF8(text, *character);
    _position += name.size() + 1;
    return {};
}

/// A line ends with a line feed, however the document ends it.
void XMLScanner::_appendCharacters(std::string& text, std::string_view characters) const {
    for (;;) {
        const auto end = characters.find('\r');
        text += characters.substr(0, end);
        if (end == std::string_view::npos)
            return;
        text += '\n';
        characters.remove_prefix(end + (characters.substr(end).starts_with("\r\n") ? 2 : 1));
    }
}

} // namespace ost::platform

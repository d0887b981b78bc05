#pragma once

#include "platform/codec/PropertyListReading.h"

#include <cstddef>
#include <expected>
#include <optional>
#include <string>
#include <string_view>

namespace ost::platform {

[[nodiscard]] constexpr bool isXMLSpace(char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r'; }

/// Takes an XML document apart, tag by tag. Comments and processing instructions are passed over, attributes too; a
/// document type declaration is passed over without being obeyed, and refused when it declares anything itself.
///
/// Threads: one. The document is borrowed and must outlive the scanner and the names it gives.
class XMLScanner {
public:
    struct Tag {
        enum class Kind { opening, closing, empty };
        Kind kind;
        std::string_view name;
    };
    template<typename T>
    using Result = std::expected<T, PropertyListError>;

    explicit XMLScanner(std::string_view document) : _document(document) {}

    /// Checks that the document is UTF-8 without forbidden characters, and reads what precedes the root element.
    [[nodiscard]] Result<void> readProlog();

    /// The next tag, which only white space may precede; absent at the end of the document.
    [[nodiscard]] Result<std::optional<Tag>> nextTag();

    /// The text from here to the closing tag `name`, which is taken too. Another element in it is an error.
    [[nodiscard]] Result<std::string> textUntilClosing(std::string_view name);

    /// An error that tells the current line.
    [[nodiscard]] std::unexpected<PropertyListError> malformed(std::string_view what) const;

private:
    [[nodiscard]] std::string_view _rest() const { return _document.substr(_position); }
    [[nodiscard]] bool _take(std::string_view expected);
    bool _skipSpace();
    Result<void> _skipPast(std::string_view end);
    Result<bool> _skipCommentOrInstruction();
    Result<void> _skipMiscellaneous();
    Result<void> _checkCharacters();
    Result<void> _readDeclaration();
    Result<void> _skipDocumentType();
    Result<std::string_view> _name();
    Result<std::string_view> _quoted();
    Result<Tag::Kind> _restOfOpeningTag();
    Result<void> _appendMarkup(std::string& text);
    Result<void> _appendReference(std::string& text);
    void _appendCharacters(std::string& text, std::string_view characters) const;

    const std::string_view _document;
    std::size_t _position = 0;
};

} // namespace ost::platform

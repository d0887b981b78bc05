#pragma once

#include "platform/base/Errno.h"

#include <concepts>
#include <cstdint>
#include <initializer_list>
#include <memory>
#include <optional>
#include <source_location>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>
#include <vector>

namespace ost::platform {

/// Appends `text` with every control character, and every byte that is not valid UTF-8, written as `\n`, `\t`, `\r` or
/// `\xNN`, so that text chosen by a client can neither break a log line nor forge one.
void appendEscaped(std::string& out, std::string_view text);

/// One argument of a message, erased to what the formatter prints. Strings are borrowed: the argument must not outlive
/// them. Any type with a `description()` member, or that an `std::optional`, a smart pointer or an `std::vector` makes
/// of one, is an argument too.
class MessageArgument {
public:
    MessageArgument(bool value) : _kind(Kind::unsignedNumber), _unsigned(value ? 1 : 0) {}
    MessageArgument(char value) : _kind(Kind::text), _owned(1, value), _text(_owned) {}
    template<std::signed_integral T>
    MessageArgument(T value) : _kind(Kind::signedNumber), _signed(value) {}
    template<std::unsigned_integral T>
    MessageArgument(T value) : _kind(Kind::unsignedNumber), _unsigned(value) {}
    template<typename T>
        requires std::is_enum_v<T>
    MessageArgument(T value) : MessageArgument(static_cast<std::underlying_type_t<T>>(value)) {}
    MessageArgument(double value);
    MessageArgument(std::string_view text) : _kind(Kind::text), _text(text) {}
    MessageArgument(const std::string& text) : _kind(Kind::text), _text(text) {}
    MessageArgument(const char* text) : _kind(Kind::text), _text(text ? text : "(null)") {}
    MessageArgument(std::nullptr_t) : _kind(Kind::text), _text("(null)") {}
    MessageArgument(const void* pointer) : _kind(Kind::pointer), _unsigned(reinterpret_cast<std::uintptr_t>(pointer)) {}
    MessageArgument(Errno error) : _kind(Kind::error), _signed(error) {}
    template<typename T>
        requires requires(const T& value) {
            { value.description() } -> std::convertible_to<std::string>;
        }
    MessageArgument(const T& value) : _kind(Kind::text), _owned(value.description()), _text(_owned) {}
    template<typename T>
    MessageArgument(const std::optional<T>& value) : MessageArgument(owned(value ? text(*value) : "(null)")) {}
    template<typename T>
    MessageArgument(const std::shared_ptr<T>& value) : MessageArgument(owned(value ? text(*value) : "(null)")) {}
    template<typename T>
    MessageArgument(const std::vector<T>& values) : MessageArgument(owned(list(values))) {}

    MessageArgument(const MessageArgument&) = delete;
    MessageArgument& operator=(const MessageArgument&) = delete;

    /// Appends the argument as the placeholder's conversion letter asks (`x` and `p` print hexadecimal, `o` octal).
    void appendTo(std::string& out, char conversion) const;

private:
    enum class Kind : std::uint8_t { text, signedNumber, unsignedNumber, pointer, error };
    struct Owned {
        std::string text;
    };

    explicit MessageArgument(Owned&& value) : _kind(Kind::text), _owned(std::move(value.text)), _text(_owned) {}
    static Owned owned(std::string text) { return Owned{std::move(text)}; }

    template<typename T>
    static std::string text(const T& value) {
        std::string out;
        MessageArgument(value).appendTo(out, '@');
        return out;
    }
    template<typename T>
    static std::string list(const std::vector<T>& values) {
        std::string out = "(";
        for (const auto& value : values) {
            if (out.size() > 1)
                out += ", ";
            MessageArgument(value).appendTo(out, '@');
        }
        return out + ")";
    }

    Kind _kind;
    union {
        std::int64_t _signed;
        std::uint64_t _unsigned;
    };
    std::string _owned;
    std::string_view _text;
};

/// Counts the placeholders of a message: `%` with an optional `l` or `ll` and one of `@ u d s x o c p`.
/// A malformed placeholder is a compile-time error.
consteval std::size_t messagePlaceholders(std::string_view format) {
    std::size_t count = 0;
    for (std::size_t i = 0; i < format.size(); ++i) {
        if (format[i] != '%')
            continue;
        ++i;
        while (i < format.size() && format[i] == 'l')
            ++i;
        if (i == format.size() || std::string_view("@udsxocp").find(format[i]) == std::string_view::npos)
            throw "malformed placeholder";
        ++count;
    }
    return count;
}

/// A message text with as many placeholders as `Arguments`, and the place that raised it.
template<typename... Arguments>
class MessageFormat {
public:
    template<std::size_t size>
    consteval MessageFormat(const char (&format)[size], std::source_location where = std::source_location::current())
        : _format(format, size - 1), _where(where) {
        if (messagePlaceholders(_format) != sizeof...(Arguments))
            throw "the number of arguments differs from the number of placeholders";
    }

    [[nodiscard]] constexpr std::string_view text() const { return _format; }
    [[nodiscard]] constexpr const std::source_location& where() const { return _where; }

private:
    std::string_view _format;
    std::source_location _where;
};

/// The format type of a function that takes the arguments behind it.
template<typename... Arguments>
using Message = MessageFormat<std::type_identity_t<Arguments>...>;

/// What the next function is made of; call that one, which sees to it that there is an argument for each placeholder.
[[nodiscard]] std::string formatMessage(std::string_view format,
                                        std::initializer_list<const MessageArgument*> arguments);

/// Replaces the placeholders of `format`, in order, by the arguments.
template<typename... Arguments>
[[nodiscard]] std::string formatMessage(Message<Arguments...> format, const Arguments&... arguments) {
    // The temporaries live until the end of the full expression, which is all that the formatter needs.
    return [&](const auto&... erased) {
        return formatMessage(format.text(), {&erased...});
    }(MessageArgument(arguments)...);
}

/// The qualified name of the function at `where`, without namespaces `ost` and `platform`, result, arguments or
/// lambdas: "OSTMetadata::writeMetadataToDisk".
[[nodiscard]] std::string qualifiedFunctionName(const std::source_location& where);

/// The last part of a qualified name: "writeMetadataToDisk".
[[nodiscard]] std::string_view lastPartOfFunctionName(std::string_view qualifiedName);

} // namespace ost::platform

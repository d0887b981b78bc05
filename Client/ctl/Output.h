#pragma once

#include "Client/Error.h"
#include "platform/base/OSTValue.h"

#include <expected>
#include <string>
#include <string_view>

namespace ostrand::ctl {

/// What a command has to say when it succeeded, for people and for programs.
struct Report {
    std::string text;        ///< whole lines, already escaped
    ost::OSTDictionary json; ///< empty where standard output is that of a program that the command ran
    int exitStatus = 0;      ///< the program's, or what the command found
};

/// Why a command did not do what it was asked.
struct Failure {
    static constexpr int usageStatus = 2;

    /// The command line asks for something that cannot be meant.
    [[nodiscard]] static Failure usage(std::string message);
    /// A request was refused, failed or never arrived.
    [[nodiscard]] static Failure of(const Error& error);
    /// Something on this side may not be done.
    [[nodiscard]] static Failure local(std::string message);
    /// A system call on this side failed: "doing: reason".
    [[nodiscard]] static Failure system(std::string_view doing, int errnoValue);

    int exitStatus;
    std::string message;     ///< already escaped
    ost::OSTDictionary json; ///< {"error": {"kind": ..., "code": ..., "message": ...}}
};

using Outcome = std::expected<Report, Failure>;

/// Text for a terminal: control characters and bytes that are no UTF-8 are written as escapes.
[[nodiscard]] std::string escaped(std::string_view text);

/// A value as JSON on one line. Strings come out as valid UTF-8 whatever they hold (a byte that is none becomes
/// U+FFFD), data as a string of hexadecimal digits, dates as seconds since 1970, a real that JSON cannot express as
/// null.
[[nodiscard]] std::string jsonText(const ost::OSTValue& value);

/// A dictionary as an indented tree, for people: one line for each key or element, strings in quotes and escaped as in
/// JSON, data as `<hex>`, dates in ISO 8601.
[[nodiscard]] std::string treeText(const ost::OSTDictionary& dictionary);

} // namespace ostrand::ctl

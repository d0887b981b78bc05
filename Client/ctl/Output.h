#pragma once

#include "Client/Error.h"
#include "platform/base/OSTValue.h"

#include <expected>
#include <string>
#include <string_view>
#include <vector>

namespace ostrand::ctl {

/// What a command has to say when it succeeded, for people and for programs.
struct Report {
    std::string text; ///< whole lines, already escaped
    ost::OSTDictionary json;
    int exitStatus = 0;     ///< the program's, or what the command found
    bool isPrinted = false; ///< standard output is that of a program that the command ran, or has what there was to say
};

/// Why a command did not do what it was asked.
struct Failure {
    static constexpr int usageStatus = 2;

    /// The command line asks for something that cannot be meant.
    [[nodiscard]] static Failure usage(std::string message);
    /// A request was refused, failed or never arrived.
    [[nodiscard]] static Failure of(const Error& error);
    /// The same in other words, for a command of which the code says something else than usual.
    [[nodiscard]] static Failure of(const Error& error, const std::string& message, std::string hint);
    /// Something on this side may not be done.
    [[nodiscard]] static Failure local(std::string message);
    /// A system call on this side failed: "doing: reason".
    [[nodiscard]] static Failure system(std::string_view doing, int errnoValue);

    int exitStatus;
    std::string message;     ///< already escaped
    ost::OSTDictionary json; ///< {"error": {"kind": ..., "code": ..., "message": ..., "hint": ...}}
    std::string hint = {};   ///< what can be done about it; may be empty
    bool isUsage = false;    ///< the command's usage helps
};

using Outcome = std::expected<Report, Failure>;

/// Text for a terminal: control characters and bytes that are no UTF-8 are written as escapes.
[[nodiscard]] std::string escaped(std::string_view text);

/// Rows of cells in columns that align, two blanks apart, for people. The cells must be escaped already.
class Table {
public:
    void add(std::vector<std::string> row) { _rows.push_back(std::move(row)); }
    /// One line for each row, without blanks at its end.
    [[nodiscard]] std::string text() const;

private:
    std::vector<std::vector<std::string>> _rows;
};

/// "17.2 MiB"; `exact`: the bytes as a plain number. Texts of either kind are of one width, so that their digits align.
[[nodiscard]] std::string sizeText(std::uint64_t bytes, bool exact = false);

/// "1 file", "2 files".
[[nodiscard]] std::string countOf(std::uint64_t count, std::string_view thing);

/// A value as JSON on one line. Strings come out as valid UTF-8 whatever they hold (a byte that is none becomes
/// U+FFFD), data as a string of hexadecimal digits, dates as seconds since 1970, a real that JSON cannot express as
/// null.
[[nodiscard]] std::string jsonText(const ost::OSTValue& value);

/// A dictionary as an indented tree, for people: one line for each key or element, strings in quotes and escaped as in
/// JSON, data as `<hex>`, dates in ISO 8601.
[[nodiscard]] std::string treeText(const ost::OSTDictionary& dictionary);

} // namespace ostrand::ctl

#pragma once

#include "platform/base/OSTError.h"

#include <exception>
#include <source_location>
#include <string>
#include <type_traits>
#include <utility>
#include <vector>

namespace ost {

/// An exception as the reports show it.
struct OSTCaughtException {
    std::string name;   ///< the exception's type
    std::string reason; ///< what it says of itself, or empty
    std::vector<std::string> callStackSymbols;

    /// Describes the exception that is being handled. Only inside a catch block.
    [[nodiscard]] static OSTCaughtException current();

    [[nodiscard]] std::string description() const { return name + ": " + reason; }
};

/// The report that ends an internal build's process: heading, thread, exception, call stack.
[[nodiscard]] std::string OSTUncaughtExceptionReport(const OSTCaughtException& exception);

/// Turns the exception that is being handled into the logged error with code 40, raised by the guarded operation
/// `where`. On a device with the capability "InternalBuild" it writes the report as the crash message and aborts
/// instead of returning.
[[nodiscard]] OSTError OSTErrorFromCurrentException(const std::source_location& where);

/// Runs the body of a public operation. An exception, which stands for a programming error or exhausted memory, becomes
/// the operation's failure with code 40; what the body owned is released on the way out. The body's result is an
/// `OSTResult`.
template<typename Body>
[[nodiscard]] std::invoke_result_t<Body> OSTGuarded(Body&& body,
                                                    std::source_location where = std::source_location::current()) {
    try {
        return std::forward<Body>(body)();
    } catch (...) {
        return std::unexpected(OSTErrorFromCurrentException(where));
    }
}

} // namespace ost

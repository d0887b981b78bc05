#pragma once

#include "Protocol/OSTErrorCode.h"
#include "platform/base/Log.h"
#include "platform/base/MessageFormat.h"
#include "platform/base/Try.h"

#include <cstdint>
#include <expected>
#include <memory>
#include <optional>
#include <source_location>
#include <string>
#include <string_view>

namespace ost {

/// The function that a failure is reported for, and the line of the statement that raises it.
struct ErrorPlace {
    // NOLINTNEXTLINE(google-explicit-constructor): a place of the source is one
    ErrorPlace(const std::source_location& raised) : ErrorPlace(raised, raised.line()) {}
    ErrorPlace(const std::source_location& reported, std::uint32_t lineOfRaise)
        : function(reported), line(lineOfRaise) {}

    std::source_location function;
    std::uint32_t line;
};

/// A failure: its domain and code, the message, what caused it, and the place that raised it.
///
/// A value, cheap to copy; immutable and safe to share between threads. `OSTCreateError` and `OSTCreatePOSIXError` are
/// the only makers.
class OSTError {
public:
    enum class Domain : std::uint8_t {
        ost,     ///< the system's own codes
        posix,   ///< the code is an errno
        general, ///< the platform's own: 2048, a property list that is no dictionary or cannot be parsed
    };

    [[nodiscard]] Domain domain() const { return _record->domain; }
    /// The domain as messages name it: "OSTErrorDomain", "POSIX" or "general".
    [[nodiscard]] std::string_view domainName() const;
    [[nodiscard]] OSTErrorCode code() const { return _record->code; }
    /// Where the contract is a code, an error goes on as its code: OST_TRY and `return` make the step.
    operator OSTErrorCode() const { return code(); }
    [[nodiscard]] const std::optional<std::string>& message() const { return _record->message; }
    [[nodiscard]] const std::shared_ptr<const OSTError>& underlyingError() const { return _record->underlyingError; }
    /// The qualified name of the raising function: "OSTMetadata::writeMetadataToDisk".
    [[nodiscard]] const std::string& functionName() const { return _record->functionName; }
    [[nodiscard]] std::uint32_t sourceFileLine() const { return _record->sourceFileLine; }

    [[nodiscard]] bool is(OSTErrorCode code) const { return domain() == Domain::ost && this->code() == code; }
    [[nodiscard]] bool isPOSIX(int errnoValue) const {
        return domain() == Domain::posix && code() == static_cast<OSTErrorCode>(errnoValue);
    }

    /// "domain code: message (underlying error)", for messages that show an error.
    [[nodiscard]] std::string description() const;

private:
    struct Record {
        Domain domain;
        OSTErrorCode code;
        std::optional<std::string> message;
        std::shared_ptr<const OSTError> underlyingError;
        std::string functionName;
        std::uint32_t sourceFileLine;
    };
    explicit OSTError(Record record) : _record(std::make_shared<const Record>(std::move(record))) {}

    friend OSTError makeError(OSTError::Domain, OSTErrorCode, const ErrorPlace&, const OSTError*, bool,
                              std::optional<std::string>);
    std::shared_ptr<const Record> _record;
};

template<typename T>
using OSTResult = std::expected<T, OSTError>;

/// Whether an error is written to the log when it is made.
enum class OSTLogging : bool { silent, logged };

/// The common part of the makers below; call those.
[[nodiscard]] OSTError makeError(OSTError::Domain domain, OSTErrorCode code, const ErrorPlace& where,
                                 const OSTError* underlyingError, bool log, std::optional<std::string> message);

/// Makes an error of the system's own domain and, unless `logging` says otherwise, writes it to the log at error level
/// as "line: message" or "line: message (underlying error)". Function name and line are those of the calling statement.
template<typename... Arguments>
[[nodiscard]] OSTError OSTCreateError(OSTErrorCode code, OSTLogging logging, const OSTError* underlyingError,
                                      platform::Message<Arguments...> format, const Arguments&... arguments) {
    return makeError(OSTError::Domain::ost, code, format.where(), underlyingError, logging == OSTLogging::logged,
                     platform::formatMessage<Arguments...>(format, arguments...));
}
template<typename... Arguments>
[[nodiscard]] OSTError OSTCreateError(OSTErrorCode code, platform::Message<Arguments...> format,
                                      const Arguments&... arguments) {
    return OSTCreateError<Arguments...>(code, OSTLogging::logged, nullptr, format, arguments...);
}
/// The same, caused by `underlyingError`.
template<typename... Arguments>
[[nodiscard]] OSTError OSTCreateError(OSTErrorCode code, const OSTError& underlyingError,
                                      platform::Message<Arguments...> format, const Arguments&... arguments) {
    return OSTCreateError<Arguments...>(code, OSTLogging::logged, &underlyingError, format, arguments...);
}

/// The same for a failure that several operations share: the function name is that of `where`.
template<typename... Arguments>
[[nodiscard]] OSTError OSTCreateErrorAt(const std::source_location& where, OSTErrorCode code,
                                        const OSTError* underlyingError, platform::Message<Arguments...> format,
                                        const Arguments&... arguments) {
    return makeError(OSTError::Domain::ost, code, {where, format.where().line()}, underlyingError, true,
                     platform::formatMessage<Arguments...>(format, arguments...));
}

/// Makes an error of the POSIX domain with `errnoValue` as code; never logged.
template<typename... Arguments>
[[nodiscard]] OSTError OSTCreatePOSIXError(int errnoValue, platform::Message<Arguments...> format,
                                           const Arguments&... arguments) {
    return makeError(OSTError::Domain::posix, static_cast<OSTErrorCode>(errnoValue), format.where(), nullptr, false,
                     platform::formatMessage<Arguments...>(format, arguments...));
}

/// Makes the error for a file whose content is not the property list that was expected; never logged.
template<typename... Arguments>
[[nodiscard]] OSTError OSTCreatePropertyListError(platform::Message<Arguments...> format,
                                                  const Arguments&... arguments) {
    return makeError(OSTError::Domain::general, OSTErrorCode::corruptPropertyList, format.where(), nullptr, false,
                     platform::formatMessage<Arguments...>(format, arguments...));
}

} // namespace ost

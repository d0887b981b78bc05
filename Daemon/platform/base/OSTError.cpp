#include "platform/base/OSTError.h"

namespace ost {

std::string_view OSTError::domainName() const {
    switch (domain()) {
    case Domain::ost:
        return "OSTErrorDomain";
    case Domain::posix:
        return "POSIX";
    case Domain::general:
        break;
    }
    return "general";
}

std::string OSTError::description() const {
    std::string text;
    text.append(domainName()).append(" ").append(std::to_string(static_cast<std::int64_t>(code())));
    if (message())
        text.append(": ").append(*message());
    if (underlyingError())
        text.append(" (").append(underlyingError()->description()).append(")");
    return text;
}

OSTError makeError(OSTError::Domain domain, OSTErrorCode code, const ErrorPlace& where, const OSTError* underlyingError,
                   bool log, std::optional<std::string> message) {
    std::string function = platform::qualifiedFunctionName(where.function);
    if (log && message) {
        const auto name = platform::lastPartOfFunctionName(function);
        if (underlyingError)
            platform::logAs(platform::LogLevel::error, name, "%d: %@ (%@)", where.line, *message, *underlyingError);
        else
            platform::logAs(platform::LogLevel::error, name, "%d: %@", where.line, *message);
    }
    return OSTError({domain, code, std::move(message),
                     underlyingError ? std::make_shared<const OSTError>(*underlyingError) : nullptr,
                     std::move(function), where.line});
}

} // namespace ost

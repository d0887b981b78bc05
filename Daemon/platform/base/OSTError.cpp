#include "platform/base/OSTError.h"

namespace ost {

namespace {

std::string_view nameOf(OSTError::Domain domain) {
    switch (domain) {
    case OSTError::Domain::ost:
        return "OSTErrorDomain";
    case OSTError::Domain::posix:
        return "POSIX";
    case OSTError::Domain::general:
        return "general";
    }
    return "general";
}

} // namespace

std::string OSTError::description() const {
    std::string text;
    text.append(nameOf(domain())).append(" ").append(std::to_string(static_cast<std::int64_t>(code())));
    if (message())
        text.append(": ").append(*message());
    if (underlyingError())
        text.append(" (").append(underlyingError()->description()).append(")");
    return text;
}

OSTError makeError(OSTError::Domain domain, OSTErrorCode code, const std::source_location& where,
                   const OSTError* underlyingError, bool log, std::optional<std::string> message) {
    std::string function = platform::qualifiedFunctionName(where);
    if (log && message) {
        const auto name = platform::lastPartOfFunctionName(function);
        if (underlyingError)
            platform::logAs(platform::LogLevel::error, name, "%d: %@ (%@)", where.line(), *message, *underlyingError);
        else
            platform::logAs(platform::LogLevel::error, name, "%d: %@", where.line(), *message);
    }
    return OSTError({domain, code, std::move(message),
                     underlyingError ? std::make_shared<const OSTError>(*underlyingError) : nullptr,
                     std::move(function), where.line()});
}

} // namespace ost

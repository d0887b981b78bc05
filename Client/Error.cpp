#include "Client/Error.h"

#include "Protocol/OSTErrorCode.h"

#include <cstring>

namespace ostrand {

namespace {

/// Numbers that no Linux errno reaches; keeps the host from inventing names.
constexpr std::uint64_t errnoBound = 4096;

/// The system's own codes come first; any other number is an errno of a file operation.
std::string meaningOfCode(std::uint64_t code) {
    if (const auto meaning = ost::meaningOf(static_cast<ost::OSTErrorCode>(code)); !meaning.empty())
        return std::string(meaning);
    if (code >= errnoBound || strerrordesc_np(static_cast<int>(code)) == nullptr)
        return "unknown code";
    return std::string("system error: ") + strerrordesc_np(static_cast<int>(code));
}

} // namespace

std::string Error::description() const {
    switch (kind) {
    case Kind::refused:
        return "the daemon refused the request and closed the connection";
    case Kind::failed:
        return "error " + std::to_string(code) + ": " + meaningOfCode(code);
    case Kind::transport:
        break;
    }
    return std::string("cannot talk to the daemon: ") + std::strerror(static_cast<int>(code));
}

} // namespace ostrand

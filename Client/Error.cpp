#include "Client/Error.h"

#include "Client/ErrorCodes.h"

#include <cstring>

namespace ostrand {

std::string Error::description() const {
    switch (kind) {
    case Kind::refused:
        return "the daemon refused the request and closed the connection";
    case Kind::failed:
        return "error " + std::to_string(code) + ": " + meaningOfErrorCode(code);
    case Kind::transport:
        break;
    }
    return std::string("cannot talk to the daemon: ") + std::strerror(static_cast<int>(code));
}

} // namespace ostrand

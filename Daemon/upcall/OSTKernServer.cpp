#include "upcall/OSTKernServer.h"

#include "platform/base/Log.h"

#include <bit>
#include <cstring>

namespace ost {

namespace {

static_assert(std::endian::native == std::endian::little, "messages are in native byte order");

constexpr std::uint32_t replyPortDisposition =
    0x1f; ///< bits of the header that name the kind of the reply port's right
constexpr std::uint32_t replyIdOffset = 100;
constexpr std::int32_t unknownRequest = -303;

/// The head of a request, as far as a failure reply depends on it.
struct RequestHead {
    std::uint32_t bits;
    std::uint32_t size;
    std::uint32_t replyPort;
    std::uint32_t localPort;
    std::uint32_t reserved;
    std::uint32_t messageId;
};

struct FailureReply {
    std::uint32_t bits;
    std::uint32_t size;
    std::uint32_t replyPort;
    std::uint32_t localPort;
    std::uint32_t reserved;
    std::uint32_t messageId;
    std::uint8_t dataRepresentation[8];
    std::int32_t returnCode;
};
static_assert(sizeof(FailureReply) == 36);

platform::UpcallReply failureReply(const platform::UpcallMessage& message, std::int32_t returnCode) {
    RequestHead request{};
    std::memcpy(&request, message.bytes.data(), sizeof request);
    const FailureReply reply{.bits = request.bits & replyPortDisposition,
                             .size = sizeof(FailureReply),
                             .replyPort = request.replyPort,
                             .localPort = 0,
                             .reserved = 0,
                             .messageId = request.messageId + replyIdOffset,
                             // Little-endian integers, ASCII, IEEE reals.
                             .dataRepresentation = {0, 0, 0, 0, 1, 0, 0, 0},
                             .returnCode = returnCode};
    const auto* const bytes = reinterpret_cast<const std::byte*>(&reply);
    return {.bytes = {bytes, bytes + sizeof reply}, .region = std::nullopt};
}

} // namespace

std::unique_ptr<platform::UpcallPort> OSTKernServerStart(platform::RunLoop& loop,
                                                         std::expected<platform::FileDescriptor, int> receiveRight) {
    if (!receiveRight) {
        platform::logError("Failed to check in service %s: %s", OSTKernServiceName,
                           std::strerror(receiveRight.error()));
        return nullptr;
    }
    auto port = platform::UpcallPort::open(loop, *std::move(receiveRight), [](const platform::UpcallMessage& message) {
        return std::optional(failureReply(message, unknownRequest));
    });
    if (!port) {
        platform::logError("Failed to create the receive source of %s: %s", OSTKernServiceName,
                           std::strerror(port.error()));
        return nullptr;
    }
    return *std::move(port);
}

} // namespace ost

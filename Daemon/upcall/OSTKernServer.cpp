#include "upcall/OSTKernServer.h"

#include "Protocol/OSTServices.h"
#include "Protocol/OSTUpcall.h"
#include "platform/base/Log.h"
#include "upcall/OSTProcessContainers.h"

#include <array>
#include <bit>
#include <cstring>

namespace ost {

namespace {

using namespace upcall;

static_assert(std::endian::native == std::endian::little, "messages are in native byte order");

constexpr std::uint32_t forgottenRequest = 322514901;

/// Bits of the header that name the kind of the reply port's right.
constexpr std::uint32_t replyPortDisposition = 0x1f;
constexpr std::uint32_t shortestTrailer = 32;
constexpr std::size_t processIdInToken = 5;

constexpr std::int32_t noError = 0;
constexpr std::int32_t wrongRegion = -300;
constexpr std::int32_t unknownRequest = -303;
constexpr std::int32_t wrongShape = -304;
constexpr std::int32_t wrongTrailer = -309;

static_assert(sizeof(RegionMessage) == platform::upcallMessageSize);

/// What the receiver has appended to a message.
struct Trailer {
    std::uint32_t type;
    std::uint32_t size;
    std::uint32_t sequenceNumber;
    std::array<std::uint32_t, 2> securityToken;
    std::array<std::uint32_t, 8> auditToken;
};
static_assert(sizeof(Trailer) == platform::upcallTrailerSize);

std::vector<std::byte> bytesOf(const auto& reply) {
    const auto* const bytes = reinterpret_cast<const std::byte*>(&reply);
    return {bytes, bytes + sizeof reply};
}

Header replyHeader(const Header& request, std::uint32_t size) {
    return {.bits = request.bits & replyPortDisposition,
            .size = size,
            .replyPort = request.replyPort,
            .localPort = 0,
            .reserved = 0,
            .messageId = request.messageId + replyIdOffset};
}

platform::UpcallReply failureReply(const Header& request, std::int32_t returnCode) {
    return {.bytes = bytesOf(FailureReply{.header = replyHeader(request, sizeof(FailureReply)),
                                          .dataRepresentation = nativeRepresentation,
                                          .returnCode = returnCode})};
}

platform::UpcallReply successReply(const Header& request, OSTUpcallAnswer answer) {
    RegionMessage reply{.header = replyHeader(request, sizeof(RegionMessage)),
                        .descriptorCount = 1,
                        .regionAddress = 0, // the index of the descriptor that goes along
                        .regionSize = answer.size,
                        .deallocate = 1,
                        .copyOption = 1,
                        .padding = 0,
                        .descriptorType = outOfLineMemory,
                        .dataRepresentation = nativeRepresentation,
                        .count = answer.size};
    reply.header.bits |= complexMessage;
    return {.bytes = bytesOf(reply), .region = std::move(answer.region)};
}

/// Why a message is refused, or `noError`.
std::int32_t refusalOf(const platform::UpcallMessage& message, const RegionMessage& request, const Trailer& trailer) {
    if (request.header.messageId == forgottenRequest)
        return unknownRequest;
    if ((request.header.bits & complexMessage) == 0 || request.descriptorCount != 1 ||
        request.header.size != sizeof request)
        return wrongShape;
    if (request.descriptorType != outOfLineMemory || request.regionSize != request.count || !message.region)
        return wrongRegion;
    if (trailer.type != 0 || trailer.size < shortestTrailer)
        return wrongTrailer;
    return trailer.auditToken[processIdInToken] == 0 ? noError : OSTUpcallRefused;
}

platform::UpcallReply replyTo(platform::UpcallMessage& message, const RegionMessage& request) {
    Trailer trailer{};
    std::memcpy(&trailer, message.bytes.data() + sizeof request, sizeof trailer);
    auto code = refusalOf(message, request, trailer);
    std::expected<OSTUpcallAnswer, std::int32_t> answer = std::unexpected(code);
    if (code == noError) {
        answer = server_get_process_containers(*message.region);
        message.region.reset();
        code = answer ? noError : answer.error();
    }
    platform::logAs(platform::LogLevel::debug, "demux_server", "message id: %u, return code: %d",
                    request.header.messageId, code);
    return answer ? successReply(request.header, *std::move(answer)) : failureReply(request.header, code);
}

} // namespace

std::optional<platform::UpcallReply> demux_server(platform::UpcallMessage& message) {
    RegionMessage request{};
    std::memcpy(&request, message.bytes.data(), sizeof request);
    const auto messageId = request.header.messageId;
    platform::logDebug("message id: %u", messageId);
    if (messageId != processContainersRequest && messageId != forgottenRequest)
        return std::nullopt;
    return replyTo(message, request);
}

std::unique_ptr<platform::UpcallPort>
OSTKernServerStart(platform::RunLoop& loop, std::expected<platform::FileDescriptor, platform::Errno> receiveRight) {
    if (!receiveRight) {
        platform::logError("Failed to check in service %s: %s", OSTKernServiceName, receiveRight.error());
        return nullptr;
    }
    auto port = platform::UpcallPort::open(loop, *std::move(receiveRight), demux_server);
    if (!port) {
        platform::logError("Failed to create the receive source of %s: %s", OSTKernServiceName, port.error());
        return nullptr;
    }
    return *std::move(port);
}

} // namespace ost

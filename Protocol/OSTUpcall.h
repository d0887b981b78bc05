#pragma once

#include <array>
#include <cstdint>

/// The messages by which the kernel asks the daemon for the containers of a process, and what their pack buffers hold.
/// Numbers are in the machine's order.
namespace ost::upcall {

inline constexpr std::uint32_t processContainersRequest = 322514900;
inline constexpr std::uint32_t replyIdOffset = 100; ///< from a request's id to that of its reply

inline constexpr std::uint32_t complexMessage = 0x80000000; ///< bit of the header: descriptors follow it
inline constexpr std::uint8_t outOfLineMemory = 1;          ///< type of a descriptor

struct Header {
    std::uint32_t bits;
    std::uint32_t size;
    std::uint32_t replyPort;
    std::uint32_t localPort;
    std::uint32_t reserved;
    std::uint32_t messageId;
};

using DataRepresentation = std::array<std::uint8_t, 8>;
/// Little-endian integers, ASCII, IEEE reals.
inline constexpr DataRepresentation nativeRepresentation{0, 0, 0, 0, 1, 0, 0, 0};

/// A request and the reply that answers it.
struct RegionMessage {
    Header header;
    std::uint32_t descriptorCount;
    std::uint32_t regionAddress;
    std::uint32_t regionSize;
    std::uint8_t deallocate;
    std::uint8_t copyOption;
    std::uint8_t padding;
    std::uint8_t descriptorType;
    DataRepresentation dataRepresentation;
    std::uint32_t count; ///< bytes of the pack buffer
};
static_assert(sizeof(RegionMessage) == 52);

struct FailureReply {
    Header header;
    DataRepresentation dataRepresentation;
    std::int32_t returnCode;
};
static_assert(sizeof(FailureReply) == 36);

/// What the items of a request mean.
enum RequestValue : std::uint16_t {
    codeSignatureId = 0,
    containerId = 1,
    applicationId = 2,
    personaId = 3,
    appGroupId = 4,
    containerType = 5,
    systemContainerId = 6,
    systemGroupId = 7,
};

/// What the items of an answer mean.
enum AnswerValue : std::uint16_t {
    successFlag = 0,
    dataContainerPath = 1,
    temporaryPath = 2,
    answeredAppGroupId = 3,
    appGroupPath = 4,
    homePath = 100,
    systemContainerPath = 101,
    answeredSystemGroupId = 102,
    systemGroupPath = 103,
};

/// The sandbox's kinds of processes.
inline constexpr std::uint32_t applicationType = 0;
inline constexpr std::uint32_t pluginType = 1;

} // namespace ost::upcall

#include "Client/Upcall.h"

#include "Client/ServiceSocket.h"
#include "Protocol/OSTServices.h"
#include "Protocol/OSTUpcall.h"
#include "platform/base/Try.h"
#include "platform/codec/OSTPackBuffer.h"
#include "platform/ipc/UpcallPacket.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <span>

namespace ostrand {

using ost::platform::FileDescriptor;
using namespace ost::upcall;

namespace {

constexpr std::size_t answerLimit = std::size_t{16} << 20U;

template<typename T>
using Answer = std::expected<T, UpcallError>;

std::unexpected<UpcallError> transportError(int errnoValue) {
    return std::unexpected(UpcallError{UpcallError::Kind::transport, errnoValue});
}

/// Appends items until one fails.
class RequestPacker {
public:
    void add(RequestValue item, const std::string& text) {
        _take(sb_packbuff_pack_string(*_buffer, item, text.c_str(), text.size()));
    }
    void add(RequestValue item, const std::optional<std::string>& text) {
        if (text)
            add(item, *text);
    }
    void add(RequestValue item, const std::vector<std::string>& texts) {
        for (const auto& text : texts)
            add(item, text);
    }
    void add(RequestValue item, std::uint32_t number) { _take(sb_packbuff_pack_uint32(*_buffer, item, number)); }
    [[nodiscard]] Answer<std::span<const std::byte>> bytes() const {
        if (!_isComplete)
            return transportError(ENOMEM);
        return std::span(sb_packbuff_get_bytes(*_buffer), sb_packbuff_get_size(*_buffer));
    }

private:
    void _take(const ost::OSTPackBufferResult<void>& packed) { _isComplete &= packed.has_value(); }

    ost::OSTPackBufferPointer _buffer = ost::sb_packbuff_new(0);
    bool _isComplete = true;
};

RequestPacker packed(const ProcessDescription& process) {
    RequestPacker packer;
    packer.add(codeSignatureId, process.codeSigningIdentifier);
    packer.add(containerId, process.containerIdentifier);
    packer.add(personaId, process.user);
    packer.add(appGroupId, process.groups);
    packer.add(containerType, process.isPlugin ? pluginType : applicationType);
    packer.add(systemContainerId, process.systemContainer);
    packer.add(systemGroupId, process.systemGroups);
    return packer;
}

RegionMessage requestFor(std::uint32_t size) {
    return {.header = {.bits = complexMessage,
                       .size = sizeof(RegionMessage),
                       .replyPort = 0,
                       .localPort = 0,
                       .reserved = 0,
                       .messageId = processContainersRequest},
            .descriptorCount = 1,
            .regionAddress = 0, // the index of the descriptor that goes along
            .regionSize = size,
            .deallocate = 0,
            .copyOption = 0,
            .padding = 0,
            .descriptorType = outOfLineMemory,
            .dataRepresentation = nativeRepresentation,
            .count = size};
}

/// Sends a request with the pack buffer as its region.
Answer<void> sendRequest(const FileDescriptor& socket, std::span<const std::byte> buffer) {
    auto region = ost::platform::makeUpcallRegion(buffer);
    if (!region)
        return transportError(region.error());
    const auto message = requestFor(static_cast<std::uint32_t>(buffer.size()));
    const auto bytes = std::as_bytes(std::span(&message, 1));
    const auto sent = ost::platform::sendUpcallReply(
        socket.get(), {.bytes = {bytes.begin(), bytes.end()}, .region = *std::move(region)}, 0);
    if (!sent)
        return transportError(sent.error());
    return {};
}

/// Receives into `message` and gives the number of bytes; `region` is what came along.
Answer<std::size_t> receiveMessage(const FileDescriptor& socket, RegionMessage& message, FileDescriptor& region) {
    iovec data{.iov_base = &message, .iov_len = sizeof message};
    alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int))> control{};
    msghdr header{};
    header.msg_iov = &data;
    header.msg_iovlen = 1;
    header.msg_control = control.data();
    header.msg_controllen = control.size();
    ssize_t size = 0;
    while ((size = ::recvmsg(socket.get(), &header, MSG_CMSG_CLOEXEC)) < 0)
        if (errno != EINTR)
            return transportError(errno);
    if (size == 0)
        return transportError(ECONNRESET);
    const auto* const rights = CMSG_FIRSTHDR(&header);
    if (rights && rights->cmsg_level == SOL_SOCKET && rights->cmsg_type == SCM_RIGHTS) {
        int descriptor = -1;
        std::memcpy(&descriptor, CMSG_DATA(rights), sizeof descriptor);
        region.reset(descriptor);
    }
    return static_cast<std::size_t>(size);
}

Answer<std::vector<std::byte>> contentOf(const FileDescriptor& region, std::size_t size) {
    struct stat status{};
    if (!region || ::fstat(region.get(), &status) != 0 || !S_ISREG(status.st_mode) || size > answerLimit)
        return transportError(EBADMSG);
    std::vector<std::byte> content(size);
    const auto count = ::pread(region.get(), content.data(), size, 0);
    if (count != static_cast<ssize_t>(size))
        return transportError(count < 0 ? errno : EBADMSG);
    return content;
}

/// Receives the answer's pack buffer.
Answer<std::vector<std::byte>> receiveAnswer(const FileDescriptor& socket) {
    RegionMessage message{};
    FileDescriptor region;
    const auto size = OST_TRY(receiveMessage(socket, message, region));
    if (message.header.messageId != processContainersRequest + replyIdOffset || message.header.size != size)
        return transportError(EBADMSG);
    if (size == sizeof(FailureReply)) {
        FailureReply failure{};
        std::memcpy(&failure, &message, sizeof failure);
        return std::unexpected(UpcallError{UpcallError::Kind::refused, failure.returnCode});
    }
    if (size != sizeof message || message.descriptorType != outOfLineMemory || message.regionSize != message.count)
        return transportError(EBADMSG);
    return contentOf(region, message.count);
}

/// Takes the items of an answer apart. Each step gives false for an item that is not as it should be.
class AnswerReader {
public:
    explicit AnswerReader(std::vector<std::byte>& bytes)
        : _buffer(ost::sb_packbuff_init_with_buffer(bytes.data(), bytes.size(), true,
                                                    ost::OSTPackBufferDeallocType::none)) {}

    Answer<ProcessContainers> read() {
        if (!_buffer)
            return transportError(EBADMSG);
        while (const auto item = sb_packbuff_get_item_value_type(*_buffer))
            if (!_take(static_cast<AnswerValue>(*item)))
                return transportError(EBADMSG);
        if (!_success)
            return transportError(EBADMSG);
        if (!*_success)
            return std::unexpected(UpcallError{UpcallError::Kind::notFound});
        return std::move(_containers);
    }

private:
    bool _take(AnswerValue item) {
        switch (item) {
        case homePath:
            return _takePath(_containers.home);
        case dataContainerPath:
            return _takePath(_containers.data);
        case temporaryPath:
            return _takePath(_containers.temporary);
        case answeredAppGroupId:
            return _takePair(_containers.groups, appGroupPath);
        case systemContainerPath:
            return _takePath(_containers.system);
        case answeredSystemGroupId:
            return _takePair(_containers.systemGroups, systemGroupPath);
        case successFlag:
            return _takeSuccess();
        case appGroupPath:
        case systemGroupPath:
            break;
        }
        return false;
    }

    bool _takePath(std::optional<std::string>& path) {
        if (const auto text = sb_packbuff_unpack_string(*_buffer))
            path = *text;
        else
            return false;
        return true;
    }

    bool _takePair(ProcessContainers::Groups& groups, AnswerValue valueItem) {
        const auto pair = sb_packbuff_unpack_key_with_string_value(*_buffer);
        if (!pair || pair->valueType != valueItem)
            return false;
        groups.emplace_back(pair->key, pair->value);
        return true;
    }

    bool _takeSuccess() {
        if (const auto number = sb_packbuff_unpack_uint32(*_buffer))
            _success = *number == 1;
        return _success.has_value();
    }

    ost::OSTPackBufferPointer _buffer;
    std::optional<bool> _success;
    ProcessContainers _containers;
};

} // namespace

std::string UpcallError::description() const {
    switch (kind) {
    case Kind::transport:
        return std::string("cannot talk to the daemon: ") + std::strerror(static_cast<int>(code));
    case Kind::refused:
        return "the daemon refused to look the containers up: code " + std::to_string(code);
    case Kind::notFound:
        break;
    }
    return "a container could not be looked up or made; the daemon's log says which, and why";
}

Answer<ProcessContainers> processContainers(const std::string& device, const ProcessDescription& process,
                                            std::optional<std::chrono::milliseconds> timeout) {
    const auto deadline = timeout ? Deadline(std::chrono::steady_clock::now() + *timeout) : std::nullopt;
    const auto packer = packed(process);
    const auto bytes = OST_TRY(packer.bytes());
    const auto socket = connectToService(device, ost::OSTKernServiceName, SOCK_SEQPACKET, timeout);
    if (!socket)
        return transportError(static_cast<int>(socket.error().code));
    OST_TRY(sendRequest(*socket, bytes));
    if (const auto ready = awaitEvents(*socket, POLLIN, deadline); !ready)
        return transportError(static_cast<int>(ready.error().code));
    auto answer = OST_TRY(receiveAnswer(*socket));
    return AnswerReader(answer).read();
}

} // namespace ostrand

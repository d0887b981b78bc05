#include "Client/Connection.h"

#include "Client/ServiceSocket.h"
#include "Protocol/OSTErrorCode.h"
#include "Protocol/OSTKeys.h"
#include "Protocol/OSTServices.h"
#include "platform/base/Assert.h"
#include "platform/base/Try.h"

#include <algorithm>
#include <cerrno>
#include <poll.h>
#include <sys/socket.h>

namespace ostrand {

using ost::platform::CBOREncoder;
using ost::platform::FileDescriptor;
using ost::platform::IPCFrame;
using ost::platform::IPCFrameHeader;

namespace replyKey = ost::replyKey;
namespace requestKey = ost::requestKey;

namespace {

/// What one system call takes in; replies are short, listings come in several such pieces.
constexpr std::size_t receiveSize = 16 * 1024;

std::unexpected<Error> transportError(int errnoValue) { return std::unexpected(Error::transport(errnoValue)); }

/// The errnos by which a socket tells that the other side has gone.
bool meansClosed(int errnoValue) { return errnoValue == EPIPE || errnoValue == ECONNRESET; }

} // namespace

Request::Request(ost::OSTCommand command) {
    key(requestKey::command).unsignedNumber(static_cast<std::uint64_t>(command));
}

CBOREncoder Request::key(std::string_view key) {
    ++_entryCount;
    CBOREncoder encoder(_entries);
    encoder.key(key);
    return encoder;
}

std::string Request::_frame(std::uint32_t requestNumber) const {
    std::string frame(IPCFrameHeader::size, '\0');
    frame.reserve(IPCFrameHeader::size + 9 + _entries.size());
    CBOREncoder(frame).beginMap(_entryCount);
    frame += _entries;
    const auto payloadLength = static_cast<std::uint32_t>(frame.size() - IPCFrameHeader::size);
    IPCFrameHeader{payloadLength, requestNumber}.write(frame.data());
    return frame;
}

Result<Connection> Connection::open(const std::string& device, Timeout timeout) {
    auto socket = OST_TRY(connectToService(device, ost::OSTServiceName, SOCK_STREAM, timeout));
    return Connection(std::move(socket), timeout);
}

bool Connection::isClosed() const {
    if (_sendingEnded || _receivingEnded)
        return true;
    char byte = 0;
    const auto count = ::recv(_socket.get(), &byte, 1, MSG_PEEK | MSG_DONTWAIT);
    return count == 0 || (count < 0 && meansClosed(errno));
}

Deadline Connection::_deadline() const {
    return _timeout ? Deadline(std::chrono::steady_clock::now() + *_timeout) : std::nullopt;
}

Result<Reply> Connection::call(const Request& request) {
    const auto deadline = _deadline();
    const auto number = OST_TRY(_send(request, deadline));
    return _receive(number, deadline);
}

Result<std::uint32_t> Connection::send(const Request& request) { return _send(request, _deadline()); }

Result<Reply> Connection::receive(std::uint32_t requestNumber) { return _receive(requestNumber, _deadline()); }

Result<std::uint32_t> Connection::_send(const Request& request, const Deadline& deadline) {
    if (request._entries.size() > IPCFrameHeader::maximumPayload - 9)
        return transportError(EMSGSIZE);
    if (_sendingEnded)
        return std::unexpected(*_sendingEnded);
    const auto number = ++_lastNumber;
    if (const auto sent = _sendBytes(request._frame(number), deadline); !sent) {
        _sendingEnded = sent.error();
        return std::unexpected(sent.error());
    }
    _awaited.insert(number);
    return number;
}

Result<void> Connection::_sendBytes(std::string_view bytes, const Deadline& deadline) {
    while (!bytes.empty()) {
        const auto sent = ::send(_socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
        if (sent >= 0) {
            bytes.remove_prefix(static_cast<std::size_t>(sent));
        } else if (meansClosed(errno)) {
            return std::unexpected(Error::refused());
        } else if (errno == EAGAIN) {
            const auto ready = OST_TRY(awaitEvents(_socket, POLLIN | POLLOUT, deadline));
            if (!(ready & POLLOUT))
                if (auto taken = _takeInWhatArrives(deadline); !taken)
                    return taken;
        } else if (errno != EINTR) {
            return transportError(errno);
        }
    }
    return {};
}

Result<Reply> Connection::_receive(std::uint32_t requestNumber, const Deadline& deadline) {
    while (true) {
        if (auto arrived = _arrived.extract(requestNumber)) {
            auto frame = std::make_unique<const IPCFrame>(std::move(arrived.mapped()));
            const auto root = ost::platform::validateCBOR(frame->payload());
            const auto answer = root ? root->find(replyKey::error) : std::nullopt;
            const auto code = answer ? answer->asUnsigned() : std::nullopt;
            if (!code)
                return transportError(EBADMSG);
            if (*code != static_cast<std::uint64_t>(ost::OSTErrorCode::success))
                return std::unexpected(Error::failed(*code));
            return Reply(std::move(frame), *root);
        }
        OST_ASSERT(_awaited.contains(requestNumber));
        if (auto taken = _takeInWhatArrives(deadline); !taken)
            return std::unexpected(taken.error());
    }
}

/// Takes in what has arrived, waiting for it when that is nothing. Only a deadline that passes can be tried again.
Result<void> Connection::_takeInWhatArrives(const Deadline& deadline) {
    if (_receivingEnded)
        return std::unexpected(*_receivingEnded);
    if (deadline)
        if (const auto ready = awaitEvents(_socket, POLLIN, deadline); !ready)
            return std::unexpected(ready.error());
    char scratch[receiveSize];
    const auto space = _reader->space(scratch);
    const auto count = ::recv(_socket.get(), space.data(), space.size(), 0);
    if (count < 0 && errno == EINTR)
        return {};
    auto outcome = [&]() -> Result<void> {
        if (count == 0 || (count < 0 && meansClosed(errno)))
            return std::unexpected(_reader->empty() ? Error::refused() : Error::transport(ECONNRESET));
        if (count < 0)
            return transportError(errno);
        _reader->received(static_cast<std::size_t>(count));
        auto frame = _reader->next();
        for (; frame; frame = _reader->next())
            OST_TRY(_takeIn(*std::move(frame)));
        _reader->settle();
        if (frame.error() == ost::platform::IPCFrameReader::Result::malformed)
            return transportError(EBADMSG);
        return {};
    }();
    if (!outcome)
        _receivingEnded = outcome.error();
    return outcome;
}

Result<void> Connection::_takeIn(IPCFrame frame) {
    const auto number = frame.requestNumber();
    if (_awaited.erase(number) == 0)
        return transportError(EBADMSG);
    _arrived.emplace(number, std::move(frame));
    return {};
}

} // namespace ostrand

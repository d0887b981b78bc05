#pragma once

#include "Client/Error.h"
#include "Client/ServiceSocket.h"
#include "Protocol/OSTCommand.h"
#include "platform/base/FileDescriptor.h"
#include "platform/codec/CBOR.h"
#include "platform/ipc/IPCFrame.h"

#include <cerrno>
#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>

namespace ostrand {

/// One request in the making: a command and the keys that belong to it. Threads: one at a time. Owns its bytes, and may
/// be sent more than once.
class Request {
public:
    explicit Request(ost::OSTCommand command);

    /// Begins the entry of `key`; the caller writes exactly one value, at once:
    /// `request.key("UserID").unsignedNumber(501)`. A key that stands twice, or a text that is no UTF-8, makes the
    /// daemon refuse the request.
    ost::platform::CBOREncoder key(std::string_view key);

private:
    friend class Connection;
    [[nodiscard]] std::string _frame(std::uint32_t requestNumber) const;

    std::uint64_t _entryCount = 0;
    std::string _entries;
};

/// The answer to a request that succeeded. Immutable; owns its bytes, and what it hands out borrows them.
class Reply {
public:
    /// The value of a key, absent when the reply has none.
    [[nodiscard]] std::optional<ost::platform::CBORItem> find(std::string_view key) const { return _root.find(key); }
    /// The value of a key that every such reply has: `reply.promised("ReplyUUID", &CBORItem::asUUID)`. EBADMSG when it
    /// has none.
    template<typename T>
    [[nodiscard]] Result<T> promised(std::string_view key,
                                     std::optional<T> (ost::platform::CBORItem::*read)() const) const {
        const auto item = find(key);
        auto value = item ? (*item.*read)() : std::nullopt;
        if (!value)
            return std::unexpected(Error::transport(EBADMSG));
        return *std::move(value);
    }
    /// The whole answer.
    [[nodiscard]] const ost::platform::CBORItem& root() const { return _root; }

private:
    friend class Connection;
    Reply(std::unique_ptr<const ost::platform::IPCFrame> frame, ost::platform::CBORItem root)
        : _frame(std::move(frame)), _root(root) {}

    std::unique_ptr<const ost::platform::IPCFrame> _frame; ///< at a fixed address, because `_root` points into it
    ost::platform::CBORItem _root;
};

/// One connection to the daemon.
///
/// Every function blocks until it is done, or for the connection's time limit, after which it fails with ETIMEDOUT.
/// Requests may be sent before the replies to earlier ones were received; `send` goes on taking in replies while the
/// daemon takes no more, so no number of requests under way can make the two wait for each other.
///
/// When the daemon refuses a request it closes the connection: that request and all behind it end as refused, replies
/// to those before it can still be received. Open a new connection to go on.
///
/// Threads: one at a time. Ownership: owns the socket, and the replies not yet asked for. Never raises SIGPIPE.
class Connection {
public:
    /// The longest that one call may take; absent: no limit.
    using Timeout = std::optional<std::chrono::milliseconds>;

    /// Connects to the daemon of a device, given the device's directory as this process sees it. Fails with the errno
    /// of the attempt: ENOENT when the device is not booted, ECONNREFUSED when nobody serves it.
    [[nodiscard]] static Result<Connection> open(const std::string& device, Timeout timeout = {});

    /// Takes over a stream socket that is connected already.
    explicit Connection(ost::platform::FileDescriptor socket, Timeout timeout = {})
        : _socket(std::move(socket)), _timeout(timeout) {}

    /// Sends a request and waits for its reply.
    [[nodiscard]] Result<Reply> call(const Request& request);

    /// Sends a request and gives the number by which its reply is received. After a failure nothing more can be sent.
    [[nodiscard]] Result<std::uint32_t> send(const Request& request);

    /// Waits for the reply to a request, in any order. The number must come from `send`, and its reply not yet have
    /// been received. After ETIMEDOUT the reply may be waited for again.
    [[nodiscard]] Result<Reply> receive(std::uint32_t requestNumber);

    /// Whether the daemon has ended the connection already, so that a further request could never be answered. Waits
    /// for nothing.
    [[nodiscard]] bool isClosed() const;

private:
    [[nodiscard]] Deadline _deadline() const;
    [[nodiscard]] Result<std::uint32_t> _send(const Request& request, const Deadline& deadline);
    [[nodiscard]] Result<void> _sendBytes(std::string_view bytes, const Deadline& deadline);
    [[nodiscard]] Result<Reply> _receive(std::uint32_t requestNumber, const Deadline& deadline);
    [[nodiscard]] Result<void> _takeInWhatArrives(const Deadline& deadline);
    [[nodiscard]] Result<void> _takeIn(ost::platform::IPCFrame frame);

    ost::platform::FileDescriptor _socket;
    Timeout _timeout;
    /// At a fixed address, because it points into itself.
    std::unique_ptr<ost::platform::IPCFrameReader> _reader = std::make_unique<ost::platform::IPCFrameReader>();
    std::uint32_t _lastNumber = 0;
    std::set<std::uint32_t> _awaited;                          ///< sent, and no reply arrived yet
    std::map<std::uint32_t, ost::platform::IPCFrame> _arrived; ///< replies that nobody received yet
    std::optional<Error> _sendingEnded;                        ///< why nothing more can be sent
    std::optional<Error> _receivingEnded;                      ///< why nothing more will arrive
};

} // namespace ostrand

#pragma once

#include "platform/base/UUID.h"
#include "platform/codec/CBOR.h"
#include "platform/ipc/IPCFrame.h"

#include <concepts>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace ost::platform {

class IPCConnection;

/// A request dictionary. A value that owns its bytes: what its readers give borrows them, and is valid for as long as
/// the request stays where it is.
class IPCRequest {
public:
    /// The number of `key`, 0 when it is missing or anything but an unsigned number.
    [[nodiscard]] std::uint64_t unsignedValue(std::string_view key) const;
    /// The number of `key` in either integer form, 0 when it is missing or does not fit.
    [[nodiscard]] std::int64_t signedValue(std::string_view key) const;
    /// The boolean of `key`, false when it is missing or anything else.
    [[nodiscard]] bool booleanValue(std::string_view key) const;
    [[nodiscard]] std::optional<std::string_view> stringValue(std::string_view key) const;
    [[nodiscard]] std::optional<UUID> uuidValue(std::string_view key) const;
    /// The value of `key`, of whatever type; absent when it is missing or null.
    [[nodiscard]] std::optional<CBORItem> item(std::string_view key) const { return _root().find(key); }

private:
    friend class IPCConnection;

    /// Takes a frame whose payload `validateCBOR` accepted.
    IPCRequest(IPCFrame frame, std::uint64_t sequence) : _frame(std::move(frame)), _sequence(sequence) {}
    [[nodiscard]] CBORItem _root() const { return CBORItem::ofValid(_frame.payload()); }

    IPCFrame _frame;
    std::uint64_t _sequence; ///< counts the requests of the connection
    bool _hasReply = false;
};

/// Where replies go: the connection that their requests came in on. Threads: any.
class IPCReplyReceiver {
public:
    virtual ~IPCReplyReceiver() = default;
    /// Takes the frame that answers the request with that sequence.
    virtual void sendReply(std::string frame, std::uint64_t sequence) = 0;
    /// A reply will not come.
    virtual void abandonReply() = 0;

protected:
    IPCReplyReceiver() = default;
    IPCReplyReceiver(const IPCReplyReceiver&) = default;
    IPCReplyReceiver& operator=(const IPCReplyReceiver&) = default;
};

/// The reply to one request: a dictionary that goes to the request's sender. Made by `IPCConnection::createReply`;
/// move-only.
///
/// Threads: one at a time, not necessarily the one that got the request. A reply that is destroyed without having been
/// sent leaves its request unanswered. Each key is set once.
class IPCReply {
public:
    IPCReply(IPCReply&&) noexcept = default;
    IPCReply& operator=(IPCReply&&) = delete;
    ~IPCReply();

    template<std::same_as<bool> T>
    void set(std::string_view key, T value) {
        encoder(key).boolean(value);
    }
    template<std::unsigned_integral T>
        requires(!std::same_as<T, bool>)
    void set(std::string_view key, T value) {
        encoder(key).unsignedNumber(value);
    }
    template<std::signed_integral T>
    void set(std::string_view key, T value) {
        encoder(key).signedNumber(value);
    }
    void set(std::string_view key, std::string_view value) { encoder(key).text(value); }
    void set(std::string_view key, const char* value) { encoder(key).text(value); }
    void set(std::string_view key, const UUID& value) { encoder(key).uuid(value); }
    void set(std::string_view key, std::span<const std::string> values);
    void set(std::string_view key, std::span<const UUID> values);
    void set(std::string_view key, const std::vector<std::string>& values) { set(key, std::span(values)); }
    void set(std::string_view key, const std::vector<UUID>& values) { set(key, std::span(values)); }
    void set(std::string_view key, const CBORItem& value) { encoder(key).item(value); }

    /// For a value of any other shape: the caller writes exactly one item with the encoder, before it does anything
    /// else with the reply.
    [[nodiscard]] CBOREncoder encoder(std::string_view key);

    /// Takes back what was set.
    void clear();

    /// Whether a frame holds what was set.
    [[nodiscard]] bool fits() const;

    /// Sends the reply, once; never waits. Does nothing when the connection is gone, or was cancelled by this request
    /// or an earlier one.
    void send();

private:
    friend class IPCConnection;
    IPCReply(std::shared_ptr<IPCReplyReceiver> connection, std::uint32_t requestNumber, std::uint64_t sequence);

    std::shared_ptr<IPCReplyReceiver> _connection; ///< null once sent
    std::uint32_t _requestNumber;
    std::uint64_t _sequence;
    std::string _frame; ///< room for the header and the map's head, then the entries
    std::size_t _count = 0;
};

} // namespace ost::platform

#pragma once

#include "platform/base/FileDescriptor.h"
#include "platform/base/OSTValue.h"
#include "platform/codec/CBOR.h"

#include <sys/types.h>

#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace ost::test::wire {

// Requests made by hand, from values that are already encoded.

std::string number(std::uint64_t value);
std::string signedNumber(std::int64_t value);
std::string real(double value);
std::string truth(bool value);
std::string text(std::string_view value);
std::string uuid(const platform::UUID& value);
std::string null();

using Entries = std::vector<std::pair<std::string_view, std::string>>;

/// A map; what it holds is not checked.
std::string map(const Entries& entries);

/// Eight bytes of header, whatever they claim.
std::string header(std::uint32_t payloadLength, std::uint32_t requestNumber);
std::string frame(std::uint32_t requestNumber, std::string_view payload);
std::string request(std::uint32_t requestNumber, const Entries& entries);

/// Command 0 for a data container of the mobile user.
std::string creation(std::uint32_t requestNumber, std::string_view identifier, bool createIfNecessary = true);

/// A reply: owns its bytes.
class Reply {
public:
    Reply(std::uint32_t requestNumber, std::string payload);

    [[nodiscard]] std::uint32_t requestNumber() const { return _requestNumber; }
    /// "ReplyError"; 0, which is no code, when the reply has none.
    [[nodiscard]] std::uint64_t error() const;
    [[nodiscard]] std::string text(std::string_view key) const;
    [[nodiscard]] bool truth(std::string_view key) const;
    /// As a property-list value; none when the reply has no such key.
    [[nodiscard]] std::optional<OSTValue> value(std::string_view key) const;
    [[nodiscard]] platform::UUID uuid(std::string_view key) const;
    [[nodiscard]] std::vector<std::string> texts(std::string_view key) const;
    [[nodiscard]] std::vector<platform::UUID> uuids(std::string_view key) const;
    /// Its keys in ascending order, with blanks between them.
    [[nodiscard]] std::string keys() const;

private:
    [[nodiscard]] platform::CBORItem _root() const { return platform::CBORItem::ofValid(_payload); }

    std::uint32_t _requestNumber;
    std::string _payload;
};

/// One connection to the daemon, byte by byte. Blocks, but not for ever: a daemon that does nothing at all is an
/// exception.
class Connection {
public:
    explicit Connection(platform::FileDescriptor socket);
    /// As this very process, which is not signed.
    explicit Connection(const std::filesystem::path& socket);

    /// Sends the bytes, or as many of them as the daemon takes before it closes the connection.
    void send(std::string_view bytes);
    /// Sends as much as goes without waiting.
    void sendSome(std::string_view bytes);
    /// Says that nothing more will be sent.
    void finish();

    /// The next reply; none when the daemon has closed the connection.
    [[nodiscard]] std::optional<Reply> receive();
    /// Whether the daemon closes the connection without a further reply.
    [[nodiscard]] bool isClosed() { return !receive(); }

    /// Sends a request and gives its reply. Throws when the daemon closes the connection instead.
    Reply call(std::string_view request);
    /// Sends a request that should not be replied to, and gives whether the daemon closes the connection instead.
    [[nodiscard]] bool isRefused(std::string_view request) {
        send(request);
        return isClosed();
    }

    /// Gives the socket up.
    platform::FileDescriptor release() { return std::move(_socket); }

private:
    [[nodiscard]] std::optional<std::string> _receive(std::size_t size);

    platform::FileDescriptor _socket;
};

/// Who a client is.
struct Identity {
    std::optional<std::string> identifier = std::nullopt;
    std::optional<OSTDictionary> entitlements = std::nullopt;
    uid_t user = 0;
    mode_t programMode = 0755;
    uid_t programOwner = 0;
    /// One that is there already and is used as it is, instead of a signed copy.
    std::filesystem::path program = {};
};

/// A process of its own that runs a program of its own, signed as the identity says. Ends with the object.
class Client {
public:
    Client(std::filesystem::path socket, const Identity& identity);
    Client(const Client&) = delete;
    Client& operator=(const Client&) = delete;
    ~Client();

    /// A new connection of that process.
    [[nodiscard]] Connection connect() const;

    /// Signs the running program anew.
    void sign(const Identity& identity) const;

    [[nodiscard]] pid_t id() const { return _id; }

private:
    void _makeProgram(const Identity& identity) const;

    std::filesystem::path _program;
    platform::FileDescriptor _control;
    pid_t _id = 0;
};

/// Entitlements of those names, all true.
OSTDictionary entitlements(const std::vector<std::string>& names);

/// An identity that may do everything.
Identity allowed(std::string identifier = "com.example.allowed", uid_t user = 0);

} // namespace ost::test::wire

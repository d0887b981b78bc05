#include "EndToEnd/Wire.h"

#include "Support/BootedDevice.h"
#include "Support/ScratchDirectory.h"
#include "platform/codec/IPCValue.h"
#include "platform/device/CodeSignature.h"
#include "platform/ipc/IPCFrame.h"

#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <set>
#include <stdexcept>
#include <system_error>

namespace ost::test::wire {

using platform::CBOREncoder;
using platform::FileDescriptor;
using platform::IPCFrameHeader;

namespace {

/// The longest silence that is taken for work.
constexpr timeval patience{.tv_sec = 60, .tv_usec = 0};

constexpr uid_t mobile = 501;

void require(bool succeeded, const char* what) {
    if (!succeeded)
        throw std::system_error(errno, std::generic_category(), what);
}

std::string encoded(auto write) {
    std::string bytes;
    CBOREncoder encoder(bytes);
    write(encoder);
    return bytes;
}

FileDescriptor connectTo(const std::filesystem::path& path) {
    FileDescriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
    path.native().copy(address.sun_path, sizeof address.sun_path - 1);
    require(::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0, "connect");
    return socket;
}

} // namespace

std::string number(std::uint64_t value) {
    return encoded([&](CBOREncoder& out) { out.unsignedNumber(value); });
}

std::string signedNumber(std::int64_t value) {
    return encoded([&](CBOREncoder& out) { out.signedNumber(value); });
}

std::string real(double value) {
    return encoded([&](CBOREncoder& out) { out.real(value); });
}

std::string truth(bool value) {
    return encoded([&](CBOREncoder& out) { out.boolean(value); });
}

std::string text(std::string_view value) {
    return encoded([&](CBOREncoder& out) { out.text(value); });
}

std::string uuid(const platform::UUID& value) {
    return encoded([&](CBOREncoder& out) { out.uuid(value); });
}

std::string null() {
    return encoded([](CBOREncoder& out) { out.null(); });
}

std::string map(const Entries& entries) {
    return encoded([&](CBOREncoder& out) { out.beginMap(entries.size()); }) + [&] {
        std::string bytes;
        for (const auto& [key, value] : entries)
            bytes += text(key) + value;
        return bytes;
    }();
}

std::string header(std::uint32_t payloadLength, std::uint32_t requestNumber) {
    std::string bytes(IPCFrameHeader::size, '\0');
    IPCFrameHeader{payloadLength, requestNumber}.write(bytes.data());
    return bytes;
}

std::string frame(std::uint32_t requestNumber, std::string_view payload) {
    return header(static_cast<std::uint32_t>(payload.size()), requestNumber).append(payload);
}

std::string request(std::uint32_t requestNumber, const Entries& entries) { return frame(requestNumber, map(entries)); }

std::string creation(std::uint32_t requestNumber, std::string_view identifier, bool createIfNecessary) {
    return request(requestNumber, {{"Command", number(0)},
                                   {"ContainerClass", number(2)},
                                   {"UserID", number(mobile)},
                                   {"Identifier", text(identifier)},
                                   {"CreateIfNecessary", truth(createIfNecessary)}});
}

Reply::Reply(std::uint32_t requestNumber, std::string payload)
    : _requestNumber(requestNumber), _payload(std::move(payload)) {
    if (!platform::validateCBOR(_payload))
        throw std::runtime_error("The daemon sends a malformed reply");
}

std::uint64_t Reply::error() const {
    const auto code = _root().find("ReplyError");
    return code ? code->asUnsigned().value_or(0) : 0;
}

std::string Reply::text(std::string_view key) const {
    const auto value = _root().find(key);
    return value ? std::string(value->asText().value_or("")) : "";
}

bool Reply::truth(std::string_view key) const {
    const auto value = _root().find(key);
    return value && value->asBoolean().value_or(false);
}

std::optional<OSTValue> Reply::value(std::string_view key) const {
    const auto value = _root().find(key);
    return value ? platform::propertyListValue(*value) : std::nullopt;
}

platform::UUID Reply::uuid(std::string_view key) const {
    const auto value = _root().find(key);
    return value ? value->asUUID().value_or(platform::UUID()) : platform::UUID();
}

std::vector<std::string> Reply::texts(std::string_view key) const {
    std::vector<std::string> texts;
    if (const auto value = _root().find(key))
        for (const auto element : value->elements())
            texts.emplace_back(element.asText().value_or(""));
    return texts;
}

std::vector<platform::UUID> Reply::uuids(std::string_view key) const {
    std::vector<platform::UUID> uuids;
    if (const auto value = _root().find(key))
        for (const auto element : value->elements())
            uuids.push_back(element.asUUID().value_or(platform::UUID()));
    return uuids;
}

std::string Reply::keys() const {
    std::set<std::string_view> sorted;
    for (const auto& entry : _root().entries())
        sorted.insert(entry.key);
    std::string keys;
    for (const auto key : sorted)
        keys.append(keys.empty() ? "" : " ").append(key);
    return keys;
}

Connection::Connection(FileDescriptor socket) : _socket(std::move(socket)) {
    for (const int option : {SO_RCVTIMEO, SO_SNDTIMEO})
        require(::setsockopt(_socket.get(), SOL_SOCKET, option, &patience, sizeof patience) == 0, "setsockopt");
}

Connection::Connection(const std::filesystem::path& socket) : Connection(connectTo(socket)) {}

void Connection::send(std::string_view bytes) {
    while (!bytes.empty()) {
        const auto sent = ::send(_socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
        if (sent < 0 && (errno == EPIPE || errno == ECONNRESET))
            return;
        require(sent >= 0, "send");
        bytes.remove_prefix(static_cast<std::size_t>(sent));
    }
}

void Connection::sendSome(std::string_view bytes) {
    while (!bytes.empty()) {
        const auto sent = ::send(_socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
        if (sent < 0)
            return;
        bytes.remove_prefix(static_cast<std::size_t>(sent));
    }
}

void Connection::finish() { ::shutdown(_socket.get(), SHUT_WR); }

/// Whole, or nothing at all at the end of the connection; an end in the middle is an exception. A daemon that dies with
/// requests unread resets the connection.
std::optional<std::string> Connection::_receive(std::size_t size) {
    std::string bytes(size, '\0');
    std::size_t received = 0;
    while (received < size) {
        const auto count = ::recv(_socket.get(), bytes.data() + received, size - received, 0);
        if (received == 0 && (count == 0 || (count < 0 && errno == ECONNRESET)))
            return std::nullopt;
        require(count >= 0, "receive");
        if (count == 0)
            throw std::runtime_error("The connection ends in the middle of a reply");
        received += static_cast<std::size_t>(count);
    }
    return bytes;
}

std::optional<Reply> Connection::receive() {
    const auto head = _receive(IPCFrameHeader::size);
    if (!head)
        return std::nullopt;
    const auto parsed = IPCFrameHeader::read(head->data());
    auto payload = _receive(parsed.payloadLength);
    if (!payload)
        throw std::runtime_error("The connection ends behind the header of a reply");
    return Reply(parsed.requestNumber, *std::move(payload));
}

Reply Connection::call(std::string_view request) {
    send(request);
    auto reply = receive();
    if (!reply)
        throw std::runtime_error("The daemon closes the connection instead of a reply");
    return *std::move(reply);
}

Client::Client(std::filesystem::path socket, const Identity& identity)
    : _program(identity.program.empty() ? makeScratchDirectory(0755) / "wire-client" : identity.program) {
    if (identity.program.empty())
        _makeProgram(identity);
    int ends[2];
    require(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) == 0, "socketpair");
    _control.reset(ends[0]);
    const FileDescriptor childsEnd(ends[1]);
    _id = ::fork();
    require(_id >= 0, "fork");
    if (_id == 0) {
        if (::dup2(childsEnd.get(), STDIN_FILENO) == 0 &&
            ::setresgid(identity.user, identity.user, identity.user) == 0 &&
            ::setresuid(identity.user, identity.user, identity.user) == 0)
            ::execl(_program.c_str(), _program.c_str(), socket.c_str(), nullptr);
        ::_exit(127);
    }
}

void Client::_makeProgram(const Identity& identity) const {
    std::filesystem::copy_file(builtProgram("wire-client"), _program);
    require(::chown(_program.c_str(), identity.programOwner, identity.programOwner) == 0 &&
                ::chmod(_program.c_str(), identity.programMode) == 0,
            "prepare the program");
    sign(identity);
}

Client::~Client() {
    _control.reset();
    ::waitpid(_id, nullptr, 0);
}

void Client::sign(const Identity& identity) const {
    OSTDictionary signature;
    if (identity.identifier)
        signature.set("Identifier", *identity.identifier);
    if (identity.entitlements)
        signature.set("Entitlements", *identity.entitlements);
    const auto program = platform::openProgram(_program);
    if (!program || !platform::writeCodeSignature(program->get(), signature))
        throw std::runtime_error("A client cannot be signed");
}

Connection Client::connect() const {
    char byte = 0;
    require(::send(_control.get(), &byte, 1, MSG_NOSIGNAL) == 1, "ask the client");
    iovec data{.iov_base = &byte, .iov_len = 1};
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))];
    msghdr message{};
    message.msg_iov = &data;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    if (::recvmsg(_control.get(), &message, MSG_CMSG_CLOEXEC) != 1 || !CMSG_FIRSTHDR(&message))
        throw std::runtime_error("The client does not connect");
    int socket = -1;
    std::memcpy(&socket, CMSG_DATA(CMSG_FIRSTHDR(&message)), sizeof socket);
    return Connection(FileDescriptor(socket));
}

OSTDictionary entitlements(const std::vector<std::string>& names) {
    OSTDictionary dictionary;
    for (const auto& name : names)
        dictionary.set(name, true);
    return dictionary;
}

Identity allowed(std::string identifier, uid_t user) {
    return {.identifier = std::move(identifier),
            .entitlements = entitlements({"com.tamarok.private.Ostrand.allowed"}),
            .user = user};
}

} // namespace ost::test::wire

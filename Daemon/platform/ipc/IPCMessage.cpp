#include "platform/ipc/IPCMessage.h"

#include "platform/base/Assert.h"

#include <utility>

namespace ost::platform {

namespace {

/// Header and map head of a reply with fewer than 24 keys, which is every ordinary one.
constexpr std::size_t headerRoom = IPCFrameHeader::size + 1;
/// What most replies fit into, so that building one allocates once.
constexpr std::size_t ordinaryReply = 320;

} // namespace

std::uint64_t IPCRequest::unsignedValue(std::string_view key) const {
    const auto value = item(key);
    return value ? value->asUnsigned().value_or(0) : 0;
}

std::int64_t IPCRequest::signedValue(std::string_view key) const {
    const auto value = item(key);
    return value ? value->asSigned().value_or(0) : 0;
}

bool IPCRequest::booleanValue(std::string_view key) const {
    const auto value = item(key);
    return value && value->asBoolean().value_or(false);
}

std::optional<std::string_view> IPCRequest::stringValue(std::string_view key) const {
    const auto value = item(key);
    return value ? value->asText() : std::nullopt;
}

std::optional<UUID> IPCRequest::uuidValue(std::string_view key) const {
    const auto value = item(key);
    return value ? value->asUUID() : std::nullopt;
}

IPCReply::IPCReply(std::shared_ptr<IPCReplyReceiver> connection, std::uint32_t requestNumber, std::uint64_t sequence)
    : _connection(std::move(connection)), _requestNumber(requestNumber), _sequence(sequence) {
    _frame.reserve(ordinaryReply);
    _frame.resize(headerRoom);
}

IPCReply::~IPCReply() {
    if (_connection)
        _connection->abandonReply();
}

CBOREncoder IPCReply::encoder(std::string_view key) {
    OST_ASSERT(_connection);
    ++_count;
    CBOREncoder encoder(_frame);
    encoder.key(key);
    return encoder;
}

void IPCReply::set(std::string_view key, std::span<const std::string> values) {
    auto value = encoder(key);
    value.beginArray(values.size());
    for (const auto& text : values)
        value.text(text);
}

void IPCReply::set(std::string_view key, std::span<const UUID> values) {
    auto value = encoder(key);
    value.beginArray(values.size());
    for (const auto& uuid : values)
        value.uuid(uuid);
}

void IPCReply::clear() {
    _frame.resize(headerRoom);
    _count = 0;
}

bool IPCReply::fits() const {
    constexpr std::size_t longestMapHead = 9;
    return _frame.size() - headerRoom <= IPCFrameHeader::maximumPayload - longestMapHead;
}

void IPCReply::send() {
    OST_ASSERT(_connection);
    std::string head;
    CBOREncoder(head).beginMap(_count);
    _frame.replace(IPCFrameHeader::size, headerRoom - IPCFrameHeader::size, head);
    const auto payload = _frame.size() - IPCFrameHeader::size;
    // A length that no header can hold is refused by the connection, which knows the limit.
    IPCFrameHeader{.payloadLength = static_cast<std::uint32_t>(payload), .requestNumber = _requestNumber}.write(
        _frame.data());
    std::exchange(_connection, nullptr)->sendReply(std::move(_frame), _sequence);
}

} // namespace ost::platform

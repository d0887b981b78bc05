#include "platform/ipc/IPCFrame.h"

#include "platform/base/Assert.h"

#include <algorithm>
#include <utility>

namespace ost::platform {

std::span<char> IPCFrameReader::space(std::span<char> scratch) {
    settle();
    if (_input.empty())
        return _space = scratch;
    // Part of a frame is here. The rest is received right behind it, so that the buffer becomes the frame itself: not
    // beyond the frame's end, and at most as much again as has arrived, so that a claimed length alone costs nothing.
    std::size_t wanted = IPCFrameHeader::size;
    if (_input.size() >= IPCFrameHeader::size)
        wanted += IPCFrameHeader::read(_input.data()).payloadLength;
    OST_ASSERT(wanted > _input.size());
    const auto have = _input.size();
    const auto room = std::min(wanted - have, std::max(have, scratch.size()));
    _buffer.erase(0, static_cast<std::size_t>(_input.data() - _buffer.data()));
    // The operation may be told of more room than was asked for.
    _buffer.resize_and_overwrite(have + room, [&](char*, std::size_t) { return have + room; });
    _input = std::string_view(_buffer).substr(0, have);
    return _space = std::span(_buffer).subspan(have);
}

void IPCFrameReader::received(std::size_t count) {
    OST_ASSERT(count <= _space.size());
    _input = _input.empty() ? std::string_view(_space.data(), count)
                            : std::string_view(_input.data(), _input.size() + count);
    _space = {};
}

std::expected<IPCFrame, IPCFrameReader::Result> IPCFrameReader::next() {
    if (_input.size() < IPCFrameHeader::size)
        return std::unexpected(Result::incomplete);
    const auto header = IPCFrameHeader::read(_input.data());
    if (header.payloadLength < 1 || header.payloadLength > _maximumPayload)
        return std::unexpected(Result::malformed);
    const auto length = IPCFrameHeader::size + header.payloadLength;
    if (_input.size() < length)
        return std::unexpected(Result::incomplete);

    if (_inBuffer && _input.data() == _buffer.data() && _buffer.size() == length) {
        _input = {};
        _inBuffer = false;
        return IPCFrame(header.requestNumber, std::exchange(_buffer, {}), IPCFrameHeader::size);
    }
    IPCFrame frame(header.requestNumber, std::string(_input.substr(IPCFrameHeader::size, header.payloadLength)), 0);
    _input.remove_prefix(length);
    return frame;
}

std::optional<std::uint32_t> IPCFrameReader::claimedPayload() const {
    if (_input.size() < IPCFrameHeader::size)
        return std::nullopt;
    return IPCFrameHeader::read(_input.data()).payloadLength;
}

void IPCFrameReader::discard() {
    _input = {};
    _buffer = {};
    _inBuffer = false;
}

void IPCFrameReader::settle() {
    if (_input.empty()) {
        discard();
    } else if (!_inBuffer) {
        _buffer.assign(_input);
        _input = _buffer;
        _inBuffer = true;
    }
}

} // namespace ost::platform

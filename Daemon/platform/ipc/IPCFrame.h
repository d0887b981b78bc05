#pragma once

#include <cstddef>
#include <cstdint>
#include <expected>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>

namespace ost::platform {

/// The eight bytes before every payload, little-endian: length of the payload, request number.
struct IPCFrameHeader {
    static constexpr std::size_t size = 8;
    /// The longest payload that anyone may send; bounds what a frame can cost its reader.
    static constexpr std::uint32_t maximumPayload = 16 * 1024 * 1024;

    std::uint32_t payloadLength = 0;
    std::uint32_t requestNumber = 0;

    /// Reads `size` bytes.
    [[nodiscard]] static IPCFrameHeader read(const char* bytes) { return {_word(bytes), _word(bytes + 4)}; }

    /// Writes `size` bytes.
    void write(char* out) const {
        _putWord(out, payloadLength);
        _putWord(out + 4, requestNumber);
    }

    [[nodiscard]] bool isValid() const { return payloadLength >= 1 && payloadLength <= maximumPayload; }

private:
    static std::uint32_t _word(const char* bytes) {
        std::uint32_t word = 0;
        for (unsigned i = 4; i-- > 0;)
            word = word << 8 | static_cast<std::uint8_t>(bytes[i]);
        return word;
    }
    static void _putWord(char* out, std::uint32_t word) {
        for (unsigned i = 0; i < 4; ++i)
            out[i] = static_cast<char>(word >> (8 * i) & 0xff);
    }
};

/// A whole frame: owns its bytes.
class IPCFrame {
public:
    IPCFrame(std::uint32_t requestNumber, std::string bytes, std::size_t payloadOffset)
        : _bytes(std::move(bytes)), _payloadOffset(payloadOffset), _requestNumber(requestNumber) {}

    [[nodiscard]] std::uint32_t requestNumber() const { return _requestNumber; }
    [[nodiscard]] std::string_view payload() const { return std::string_view(_bytes).substr(_payloadOffset); }
    /// Bytes that it takes.
    [[nodiscard]] std::size_t memory() const { return _bytes.size(); }

private:
    std::string _bytes;
    std::size_t _payloadOffset;
    std::uint32_t _requestNumber;
};

/// Cuts a byte stream into frames. What is received goes where `space` says; a frame that arrives whole is taken from
/// there, one that does not is kept in a buffer that grows with the bytes that really came and is given up once it is
/// taken.
///
///     const auto space = reader.space(scratch);
///     reader.received(recv(fd, space.data(), space.size(), ...));
///     while (auto frame = reader.next()) ...
///     reader.settle(); // before the scratch is used for something else
///
/// Not thread-safe.
class IPCFrameReader {
public:
    explicit IPCFrameReader(std::uint32_t maximumPayload = IPCFrameHeader::maximumPayload)
        : _maximumPayload(maximumPayload) {}
    IPCFrameReader(const IPCFrameReader&) = delete;
    IPCFrameReader& operator=(const IPCFrameReader&) = delete;

    /// Where to receive next: `scratch`, unless part of a frame is already kept. Only when `next` gave none.
    [[nodiscard]] std::span<char> space(std::span<char> scratch);
    /// Tells that the first `count` bytes of the last `space` were filled.
    void received(std::size_t count);

    enum class Result : std::uint8_t { incomplete, malformed };
    /// The next whole frame; else whether there is none yet, or the length in its header is 0 or over the limit.
    [[nodiscard]] std::expected<IPCFrame, Result> next();

    /// Moves what is left out of the scratch.
    void settle();
    /// Gives up what is left.
    void discard();

    /// Limits the payloads from the next one on that `next` gives.
    void setMaximumPayload(std::uint32_t bytes) { _maximumPayload = bytes; }
    /// The length that the next frame claims, when all of its header is there.
    [[nodiscard]] std::optional<std::uint32_t> claimedPayload() const;

    /// Bytes that it keeps outside the scratch.
    [[nodiscard]] std::size_t memory() const { return _buffer.size(); }

    /// Whether nothing is left: no byte of a further frame has arrived.
    [[nodiscard]] bool empty() const { return _input.empty(); }

private:
    std::uint32_t _maximumPayload;
    std::string _buffer;     ///< bytes that outlived the scratch
    std::string_view _input; ///< what is not yet taken
    bool _inBuffer = false;  ///< whether _input lies in _buffer, not in the scratch
    std::span<char> _space;  ///< the last space given
};

} // namespace ost::platform

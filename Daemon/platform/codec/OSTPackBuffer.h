#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <expected>
#include <memory>
#include <optional>
#include <span>
#include <string_view>

namespace ost {

/// Every item of a pack buffer begins at a multiple of it.
inline constexpr std::size_t BYTE_ALIGNMENT = 8;

/// Why an operation on a pack buffer failed. The numbers belong to the format and are the same on every host.
enum class OSTPackBufferError : int {
    outOfMemory = 12,
    invalidArgument = 22,
    outOfRange = 34,
    notSupported = 45,
};

/// How the bytes of a pack buffer are released.
enum class OSTPackBufferDeallocType : std::uint32_t {
    none = 0,   ///< they are not owned
    free = 1,   ///< heap memory, which may grow
    region = 2, ///< mapped memory
};

/// A sequence of typed items that two sides exchange: numbers, strings and bytes, each with a number that says what it
/// means. docs/protocol.md gives the bytes. Items are either appended (to a new buffer, or to a wrapped one that holds
/// none) or unpacked from the start (of a wrapped one that holds items).
///
/// Threads: one at a time. Ownership: by `OSTPackBufferPointer`; a wrapped buffer that is not owned must outlive it.
/// What is unpacked may come from a hostile sender: no claimed length and no missing END item leads outside the buffer,
/// and its address need not be aligned.
struct sb_packbuff { // NOLINT(readability-identifier-naming)
    OSTPackBufferDeallocType dealloc_type;
    std::size_t block_size; ///< by which an owned buffer grows; 0 for a wrapped one
    std::size_t bytes_allocated;
    std::size_t bytes_remaining; ///< bytes_allocated - bytes_used
    std::size_t bytes_used;      ///< with the END item
    std::byte* item_buffer;
    std::byte* item; ///< the next to be read; while packing the END item, which the next item replaces
};

/// Releases the bytes as their dealloc type says, then the object. A region that cannot be released is reported on
/// standard output.
void sb_packbuff_free(sb_packbuff* buffer);

struct OSTPackBufferDeleter {
    void operator()(sb_packbuff* buffer) const { sb_packbuff_free(buffer); }
};
using OSTPackBufferPointer = std::unique_ptr<sb_packbuff, OSTPackBufferDeleter>;

template<typename Value>
using OSTPackBufferResult = std::expected<Value, OSTPackBufferError>;

/// A new empty buffer that grows by `blockSize` bytes, or by 256 if that is below 8. Null without memory.
[[nodiscard]] OSTPackBufferPointer sb_packbuff_new(std::size_t blockSize);

/// The same: memory carries no tags here.
[[nodiscard]] OSTPackBufferPointer sb_packbuff_new_with_tag(std::size_t blockSize);

/// Wraps `size` bytes, which cannot grow; they are to be read if `holdsItems`, else an END item is written at their
/// start. Null, with the bytes left to the caller, when `size` is 0 or no multiple of 8, or when there is no memory.
[[nodiscard]] OSTPackBufferPointer sb_packbuff_init_with_buffer(void* buffer, std::size_t size, bool holdsItems,
                                                                OSTPackBufferDeallocType deallocType);

/// The same: memory carries no tags here.
[[nodiscard]] OSTPackBufferPointer sb_packbuff_init_with_buffer_and_tag(void* buffer, std::size_t size, bool holdsItems,
                                                                        OSTPackBufferDeallocType deallocType);

[[nodiscard]] inline std::byte* sb_packbuff_get_bytes(const sb_packbuff& buffer) { return buffer.item_buffer; }
[[nodiscard]] inline std::size_t sb_packbuff_get_size(const sb_packbuff& buffer) { return buffer.bytes_used; }

/// Says how many bytes hold items. `size` is at most what is allocated.
void sb_packbuff_set_size(sb_packbuff& buffer, std::size_t size);

/// The value type of the current item; nothing at the END item.
[[nodiscard]] std::optional<std::uint16_t> sb_packbuff_get_item_value_type(const sb_packbuff& buffer);

/// Appends an item. Fails, with every item as it was, with notSupported when a wrapped buffer is full, outOfRange when
/// no item is so long, and outOfMemory. The last takes what an owned buffer holds with it.
[[nodiscard]] OSTPackBufferResult<void> sb_packbuff_pack_uint32(sb_packbuff& buffer, std::uint16_t valueType,
                                                                std::uint32_t value);

/// `length` leaves out the NUL, which must follow: else invalidArgument.
[[nodiscard]] OSTPackBufferResult<void> sb_packbuff_pack_string(sb_packbuff& buffer, std::uint16_t valueType,
                                                                const char* string, std::size_t length);

[[nodiscard]] OSTPackBufferResult<void> sb_packbuff_pack_bytes(sb_packbuff& buffer, std::uint16_t valueType,
                                                               const void* data, std::size_t length);

/// Appends two strings. The key stays when the value fails.
[[nodiscard]] OSTPackBufferResult<void> sb_packbuff_pack_key_with_string_value(sb_packbuff& buffer,
                                                                               std::uint16_t keyValueType,
                                                                               const char* key, std::uint16_t valueType,
                                                                               const char* value);

/// Reads the current item and goes on to the next. Fails, with the current item as it was, with invalidArgument for an
/// item of another type and with outOfRange when no item can follow it in the buffer.
[[nodiscard]] OSTPackBufferResult<std::uint32_t> sb_packbuff_unpack_uint32(sb_packbuff& buffer);

/// The string lies in the buffer and is followed by its NUL; it may hold others. A string item that does not end with a
/// NUL is an invalidArgument.
[[nodiscard]] OSTPackBufferResult<std::string_view> sb_packbuff_unpack_string(sb_packbuff& buffer);

/// The bytes lie in the buffer.
[[nodiscard]] OSTPackBufferResult<std::span<const std::byte>> sb_packbuff_unpack_bytes(sb_packbuff& buffer);

struct OSTPackBufferPair {
    std::string_view key;
    std::uint16_t valueType; ///< of the value's item
    std::string_view value;
};

/// Reads two strings. When one of them fails, the key is the current item again.
[[nodiscard]] OSTPackBufferResult<OSTPackBufferPair> sb_packbuff_unpack_key_with_string_value(sb_packbuff& buffer);

/// Prints the object and every item.
void sb_packbuff_print(const sb_packbuff& buffer, std::FILE* stream = stdout);

} // namespace ost

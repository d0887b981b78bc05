#include "platform/codec/OSTPackBuffer.h"

#include "platform/base/Assert.h"
#include "platform/base/Try.h"

#include <sys/mman.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <new>

namespace ost {

namespace {

using Error = OSTPackBufferError;
using DeallocType = OSTPackBufferDeallocType;
template<typename Value>
using Result = OSTPackBufferResult<Value>;

constexpr std::size_t defaultBlockSize = 256;
constexpr auto longestData = std::numeric_limits<std::uint32_t>::max();

enum class ItemType : std::uint16_t { end = 0, uint32 = 1, string = 2, bytes = 3 };

/// What every item begins with.
struct ItemHeader {
    ItemType type;
    std::uint16_t valueType;
    std::uint32_t valueOrLength;
};
static_assert(sizeof(ItemHeader) == BYTE_ALIGNMENT);
static_assert(sizeof(std::size_t) > sizeof(std::uint32_t), "the length of an item can be rounded up");

constexpr std::size_t roundedUp(std::size_t size) { return (size + BYTE_ALIGNMENT - 1) & ~(BYTE_ALIGNMENT - 1); }

ItemHeader headerAt(const std::byte* item) {
    ItemHeader header{};
    std::memcpy(&header, item, sizeof header);
    return header;
}

void putHeader(std::byte* item, const ItemHeader& header) { std::memcpy(item, &header, sizeof header); }
void putEnd(std::byte* item) { putHeader(item, {}); }

std::size_t sizeOf(const ItemHeader& header) {
    const bool hasData = header.type == ItemType::string || header.type == ItemType::bytes;
    return sizeof header + (hasData ? roundedUp(header.valueOrLength) : 0);
}

std::size_t offsetOf(const sb_packbuff& buffer, const std::byte* item) {
    return static_cast<std::size_t>(item - buffer.item_buffer);
}

bool isInside(const sb_packbuff& buffer, std::size_t offset) {
    return offset < buffer.bytes_allocated && buffer.bytes_allocated - offset >= sizeof(ItemHeader);
}

void releaseRegion(void* region, std::size_t size) {
    if (::munmap(region, size) != 0)
        std::printf("failed: munmap(%p, %zu)\n", region, size);
}

/// Makes room for `needed` more bytes behind the last item.
Result<void> grow(sb_packbuff& buffer, std::size_t needed) {
    if (buffer.dealloc_type != DeallocType::free || buffer.block_size == 0)
        return std::unexpected(Error::notSupported);
    auto size = buffer.bytes_allocated + buffer.block_size;
    if (size - buffer.bytes_used < roundedUp(needed))
        size += roundedUp(needed);
    auto* const bytes = std::realloc(buffer.item_buffer, size);
    if (!bytes) {
        std::free(buffer.item_buffer);
        buffer = {};
        return std::unexpected(Error::outOfMemory);
    }
    buffer.item_buffer = static_cast<std::byte*>(bytes);
    buffer.bytes_allocated = size;
    buffer.bytes_remaining = size - buffer.bytes_used;
    buffer.item = buffer.item_buffer + buffer.bytes_used - sizeof(ItemHeader);
    return {};
}

/// Puts an item with `length` bytes of data in the place of the END item.
Result<void> packItem(sb_packbuff& buffer, const ItemHeader& header, const void* data, std::size_t length) {
    const auto total = sizeof header + roundedUp(length);
    if (total > buffer.bytes_remaining)
        OST_TRY(grow(buffer, total));
    OST_ASSERT(isInside(buffer, offsetOf(buffer, buffer.item) + total));
    putHeader(buffer.item, header);
    auto* const begin = buffer.item + sizeof header;
    if (length > 0)
        std::memcpy(begin, data, length);
    std::fill(begin + length, buffer.item + total, std::byte{});
    buffer.bytes_remaining -= total;
    buffer.bytes_used += total;
    buffer.item += total;
    putEnd(buffer.item);
    return {};
}

Result<void> packData(sb_packbuff& buffer, ItemType type, std::uint16_t valueType, std::span<const std::byte> data) {
    if (data.size() > longestData)
        return std::unexpected(Error::outOfRange);
    return packItem(buffer, {type, valueType, static_cast<std::uint32_t>(data.size())}, data.data(), data.size());
}

/// The header of the current item, after which, too, an item fits into the buffer.
Result<ItemHeader> checkedHeader(const sb_packbuff& buffer, ItemType expected) {
    const auto offset = offsetOf(buffer, buffer.item);
    if (!isInside(buffer, offset))
        return std::unexpected(Error::outOfRange);
    const auto header = headerAt(buffer.item);
    if (header.type != expected)
        return std::unexpected(Error::invalidArgument);
    if (!isInside(buffer, offset + sizeOf(header)))
        return std::unexpected(Error::outOfRange);
    return header;
}

const std::byte* takeItem(sb_packbuff& buffer, const ItemHeader& header) {
    const auto* const data = buffer.item + sizeof header;
    buffer.item += sizeOf(header);
    return data;
}

const char* nameOf(DeallocType type) {
    switch (type) {
    case DeallocType::none:
        return "None";
    case DeallocType::free:
        return "free()";
    case DeallocType::region:
        return "munmap()";
    }
    return "<Unknown>";
}

/// Prints what follows the value type. Only what lies in the buffer is shown of a string that claims more.
void printContent(const sb_packbuff& buffer, const std::byte* item, std::FILE* stream) {
    const auto header = headerAt(item);
    const auto* const data = item + sizeof header;
    const auto length = header.valueOrLength;
    const auto padding = static_cast<unsigned>(roundedUp(length) - length);
    const auto shown = std::min<std::size_t>(length, buffer.bytes_used - offsetOf(buffer, data));
    switch (header.type) {
    case ItemType::uint32:
        std::fprintf(stream, "inline value: %u\n", length);
        break;
    case ItemType::string:
        std::fprintf(stream, "string (%p, %u pad bytes, size: %u): \n     `%.*s'\n", static_cast<const void*>(data),
                     padding, length, static_cast<int>(std::min<std::size_t>(shown, std::numeric_limits<int>::max())),
                     reinterpret_cast<const char*>(data));
        break;
    case ItemType::bytes:
        std::fprintf(stream, "bytes (%p, %u pad bytes, size: %u)\n", static_cast<const void*>(data), padding, length);
        break;
    default:
        std::fprintf(stream, "*Unknown item type* %u\n", static_cast<unsigned>(header.type));
    }
}

void printItems(const sb_packbuff& buffer, std::FILE* stream) {
    std::size_t offset = 0;
    for (int index = 0;; ++index) {
        if (offset > buffer.bytes_used || buffer.bytes_used - offset < sizeof(ItemHeader)) {
            std::fputs(">> item pointer exceeds end of buffer. <<", stream);
            return;
        }
        const auto* const item = buffer.item_buffer + offset;
        const auto* const marker = item == buffer.item ? "*" : " ";
        const auto header = headerAt(item);
        if (header.type == ItemType::end) {
            std::fprintf(stream, "%s%3d: %p -- END\n", marker, index, static_cast<const void*>(item));
            return;
        }
        std::fprintf(stream, "%s%3d:%p -- value type %u --", marker, index, static_cast<const void*>(item),
                     unsigned{header.valueType});
        printContent(buffer, item, stream);
        offset += sizeOf(header);
    }
}

OSTPackBufferPointer wrap(std::byte* bytes, std::size_t size, bool holdsItems, DeallocType deallocType) {
    const auto used = holdsItems ? size : sizeof(ItemHeader);
    OSTPackBufferPointer buffer(new (std::nothrow) sb_packbuff{.dealloc_type = deallocType,
                                                               .block_size = 0,
                                                               .bytes_allocated = size,
                                                               .bytes_remaining = size - used,
                                                               .bytes_used = used,
                                                               .item_buffer = bytes,
                                                               .item = bytes});
    if (buffer && !holdsItems)
        putEnd(bytes);
    return buffer;
}

} // namespace

OSTPackBufferPointer sb_packbuff_new(std::size_t blockSize) {
    const auto size = blockSize < BYTE_ALIGNMENT ? defaultBlockSize : blockSize;
    auto* const bytes = static_cast<std::byte*>(std::malloc(size));
    auto buffer = bytes ? wrap(bytes, size, false, DeallocType::free) : nullptr;
    if (!buffer)
        std::free(bytes);
    else
        buffer->block_size = size;
    return buffer;
}

OSTPackBufferPointer sb_packbuff_new_with_tag(std::size_t blockSize) { return sb_packbuff_new(blockSize); }

OSTPackBufferPointer sb_packbuff_init_with_buffer(void* buffer, std::size_t size, bool holdsItems,
                                                  DeallocType deallocType) {
    if (!buffer || size == 0 || size % BYTE_ALIGNMENT != 0)
        return nullptr;
    return wrap(static_cast<std::byte*>(buffer), size, holdsItems, deallocType);
}

OSTPackBufferPointer sb_packbuff_init_with_buffer_and_tag(void* buffer, std::size_t size, bool holdsItems,
                                                          DeallocType deallocType) {
    return sb_packbuff_init_with_buffer(buffer, size, holdsItems, deallocType);
}

void sb_packbuff_free(sb_packbuff* buffer) {
    if (buffer && buffer->dealloc_type == DeallocType::free)
        std::free(buffer->item_buffer);
    else if (buffer && buffer->dealloc_type == DeallocType::region)
        releaseRegion(buffer->item_buffer, buffer->bytes_allocated);
    delete buffer;
}

void sb_packbuff_set_size(sb_packbuff& buffer, std::size_t size) {
    OST_ASSERT(size <= buffer.bytes_allocated);
    buffer.bytes_used = size;
    buffer.bytes_remaining = buffer.bytes_allocated - size;
}

std::optional<std::uint16_t> sb_packbuff_get_item_value_type(const sb_packbuff& buffer) {
    if (!isInside(buffer, offsetOf(buffer, buffer.item)))
        return std::nullopt;
    const auto header = headerAt(buffer.item);
    return header.type == ItemType::end ? std::nullopt : std::optional(header.valueType);
}

Result<void> sb_packbuff_pack_uint32(sb_packbuff& buffer, std::uint16_t valueType, std::uint32_t value) {
    return packItem(buffer, {ItemType::uint32, valueType, value}, nullptr, 0);
}

Result<void> sb_packbuff_pack_string(sb_packbuff& buffer, std::uint16_t valueType, const char* string,
                                     std::size_t length) {
    if (length == std::numeric_limits<std::size_t>::max() || string[length] != '\0')
        return std::unexpected(Error::invalidArgument);
    return packData(buffer, ItemType::string, valueType, {reinterpret_cast<const std::byte*>(string), length + 1});
}

Result<void> sb_packbuff_pack_bytes(sb_packbuff& buffer, std::uint16_t valueType, const void* data,
                                    std::size_t length) {
    return packData(buffer, ItemType::bytes, valueType, {static_cast<const std::byte*>(data), length});
}

Result<void> sb_packbuff_pack_key_with_string_value(sb_packbuff& buffer, std::uint16_t keyValueType, const char* key,
                                                    std::uint16_t valueType, const char* value) {
    OST_TRY(sb_packbuff_pack_string(buffer, keyValueType, key, std::strlen(key)));
    return sb_packbuff_pack_string(buffer, valueType, value, std::strlen(value));
}

Result<std::uint32_t> sb_packbuff_unpack_uint32(sb_packbuff& buffer) {
    const auto header = OST_TRY(checkedHeader(buffer, ItemType::uint32));
    takeItem(buffer, header);
    return header.valueOrLength;
}

Result<std::string_view> sb_packbuff_unpack_string(sb_packbuff& buffer) {
    const auto header = OST_TRY(checkedHeader(buffer, ItemType::string));
    const auto length = header.valueOrLength;
    const auto* const string = reinterpret_cast<const char*>(buffer.item) + sizeof header;
    if (length == 0 || string[length - 1] != '\0')
        return std::unexpected(Error::invalidArgument);
    takeItem(buffer, header);
    return std::string_view(string, length - 1);
}

Result<std::span<const std::byte>> sb_packbuff_unpack_bytes(sb_packbuff& buffer) {
    const auto header = OST_TRY(checkedHeader(buffer, ItemType::bytes));
    return std::span(takeItem(buffer, header), header.valueOrLength);
}

Result<OSTPackBufferPair> sb_packbuff_unpack_key_with_string_value(sb_packbuff& buffer) {
    auto* const first = buffer.item;
    const auto key = OST_TRY(sb_packbuff_unpack_string(buffer));
    const auto valueType = sb_packbuff_get_item_value_type(buffer);
    const auto value = sb_packbuff_unpack_string(buffer);
    if (!value) {
        buffer.item = first;
        return std::unexpected(value.error());
    }
    return OSTPackBufferPair{key, valueType.value(), *value};
}

void sb_packbuff_print(const sb_packbuff& buffer, std::FILE* stream) {
    std::fprintf(stream, "packbuff: %p\n", static_cast<const void*>(&buffer));
    std::fprintf(stream, "  block_size:      %zu\n", buffer.block_size);
    std::fprintf(stream, "  dealloc_type:    %s\n", nameOf(buffer.dealloc_type));
    std::fprintf(stream, "  bytes_allocated: %zu\n", buffer.bytes_allocated);
    std::fprintf(stream, "  bytes_used:      %zu\n", buffer.bytes_used);
    std::fprintf(stream, "  bytes_remaining: %zu\n", buffer.bytes_remaining);
    std::fprintf(stream, "  item_buffer %p, item: %p\n\n", static_cast<const void*>(buffer.item_buffer),
                 static_cast<const void*>(buffer.item));
    printItems(buffer, stream);
}

} // namespace ost

#include "platform/base/Assert.h"
#include "platform/codec/OSTPackBuffer.h"

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <string_view>
#include <variant>
#include <vector>

using namespace ost;

namespace {

struct Bytes {
    std::span<const std::byte> data;
    bool operator==(const Bytes& other) const { return std::ranges::equal(data, other.data); }
};

struct Item {
    std::uint16_t valueType;
    std::variant<std::uint32_t, std::string_view, Bytes> content;
    bool operator==(const Item&) const = default;
};

std::optional<Item> readItem(sb_packbuff& buffer) {
    const auto valueType = sb_packbuff_get_item_value_type(buffer);
    if (!valueType)
        return std::nullopt;
    const auto* const before = buffer.item;
    if (const auto number = sb_packbuff_unpack_uint32(buffer))
        return Item{*valueType, *number};
    if (const auto string = sb_packbuff_unpack_string(buffer))
        return Item{*valueType, *string};
    if (const auto bytes = sb_packbuff_unpack_bytes(buffer))
        return Item{*valueType, Bytes{*bytes}};
    OST_ASSERT(buffer.item == before);
    return std::nullopt;
}

std::vector<Item> readItems(sb_packbuff& buffer) {
    std::vector<Item> items;
    while (const auto item = readItem(buffer))
        items.push_back(*item);
    return items;
}

void pack(sb_packbuff& buffer, const Item& item) {
    if (const auto* number = std::get_if<std::uint32_t>(&item.content))
        OST_ASSERT(sb_packbuff_pack_uint32(buffer, item.valueType, *number));
    else if (const auto* string = std::get_if<std::string_view>(&item.content))
        OST_ASSERT(sb_packbuff_pack_string(buffer, item.valueType, string->data(), string->size()));
    else if (const auto* bytes = std::get_if<Bytes>(&item.content))
        OST_ASSERT(sb_packbuff_pack_bytes(buffer, item.valueType, bytes->data.data(), bytes->data.size()));
}

void print(const sb_packbuff& buffer) {
    static std::FILE* const nowhere = std::fopen("/dev/null", "w");
    sb_packbuff_print(buffer, nowhere);
}

} // namespace

/// What can be read can be packed and reads the same again, wherever it lies in memory.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const auto whole = size / BYTE_ALIGNMENT * BYTE_ALIGNMENT;
    std::vector<std::byte> unaligned(whole + 1);
    std::copy_n(reinterpret_cast<const std::byte*>(data), whole, unaligned.data() + 1);
    const auto buffer = sb_packbuff_init_with_buffer(unaligned.data() + 1, whole, true, OSTPackBufferDeallocType::none);
    if (!buffer)
        return 0;
    const auto items = readItems(*buffer);
    print(*buffer);

    const auto packed = sb_packbuff_new(BYTE_ALIGNMENT);
    for (const auto& item : items)
        pack(*packed, item);
    const auto again = sb_packbuff_init_with_buffer(sb_packbuff_get_bytes(*packed), sb_packbuff_get_size(*packed), true,
                                                    OSTPackBufferDeallocType::none);
    OST_ASSERT(readItems(*again) == items);
    OST_ASSERT(again->item == packed->item_buffer + packed->bytes_used - BYTE_ALIGNMENT);
    return 0;
}

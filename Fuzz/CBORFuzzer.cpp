#include "platform/base/Assert.h"
#include "platform/codec/CBOR.h"

#include <cstddef>
#include <cstdint>
#include <string>

using namespace ost::platform;

namespace {

void copy(const CBORItem& item, CBOREncoder& encoder);

void copyArray(const CBORItem& array, CBOREncoder& encoder) {
    encoder.beginArray(array.count());
    for (const auto element : array.elements())
        copy(element, encoder);
}

void copyMap(const CBORItem& map, CBOREncoder& encoder) {
    std::size_t count = 0;
    for ([[maybe_unused]] const auto& entry : map.entries())
        ++count;
    OST_ASSERT(count <= map.count());
    encoder.beginMap(count);
    for (const auto& [key, value] : map.entries()) {
        encoder.key(key);
        copy(value, encoder);
    }
}

/// Writes an item anew from what its readers say.
void copy(const CBORItem& item, CBOREncoder& encoder) {
    switch (item.type()) {
    case CBORType::unsignedNumber:
        return encoder.unsignedNumber(item.asUnsigned().value());
    case CBORType::negativeNumber:
        return item.asSigned() ? encoder.signedNumber(*item.asSigned()) : encoder.item(item);
    case CBORType::boolean:
        return encoder.boolean(item.asBoolean().value());
    case CBORType::null:
        return encoder.null();
    case CBORType::real:
        return encoder.real(item.asReal().value());
    case CBORType::text:
        return encoder.text(item.asText().value());
    case CBORType::data:
        return encoder.data(item.asData().value());
    case CBORType::uuid:
        return encoder.uuid(item.asUUID().value());
    case CBORType::date:
        return encoder.date(item.asDate().value());
    case CBORType::array:
        return copyArray(item, encoder);
    case CBORType::map:
        return copyMap(item, encoder);
    }
}

std::string rewritten(const CBORItem& root) {
    std::string bytes;
    CBOREncoder encoder(bytes);
    copy(root, encoder);
    return bytes;
}

} // namespace

/// What is accepted can be read to the end and written again, and is then accepted and written the same.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string_view payload(reinterpret_cast<const char*>(data), size);
    const auto root = validateCBOR(payload);
    if (!root)
        return 0;
    OST_ASSERT(root->bytes() == payload);
    const auto once = rewritten(*root);
    const auto again = validateCBOR(once);
    OST_ASSERT(again);
    OST_ASSERT(rewritten(*again) == once);
    return 0;
}

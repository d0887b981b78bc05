#include "platform/codec/PropertyList.h"

#include "platform/codec/BinaryPropertyListFormat.h"
#include "platform/codec/BinaryPropertyListReader.h"
#include "platform/codec/XMLPropertyListReader.h"

namespace ost::platform {

std::expected<OSTValue, PropertyListError> parsePropertyList(std::string_view bytes, const PropertyListLimits& limits) {
    return bytes.starts_with(binaryPropertyList::magic) ? readBinaryPropertyList(bytes, limits)
                                                        : readXMLPropertyList(bytes, limits);
}

} // namespace ost::platform

#include "platform/PropertyList.h"

#include "platform/BinaryPropertyListFormat.h"
#include "platform/BinaryPropertyListReader.h"
#include "platform/XMLPropertyListReader.h"

namespace ost::platform {

std::expected<OSTValue, PropertyListError> parsePropertyList(std::string_view bytes, const PropertyListLimits& limits) {
    return bytes.starts_with(binaryPropertyList::magic) ? readBinaryPropertyList(bytes, limits)
                                                        : readXMLPropertyList(bytes, limits);
}

} // namespace ost::platform

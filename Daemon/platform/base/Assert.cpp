#include "platform/base/Assert.h"

#include "platform/base/Log.h"

#include <cstdlib>

namespace ost::platform {

void assertionFailed(const char* condition, std::source_location where) {
    const auto qualifiedName = qualifiedFunctionName(where);
    const auto function = lastPartOfFunctionName(qualifiedName);
    logAs(LogLevel::error, function, "Assertion failed: (%s), function %s", condition, function);
    std::abort();
}

} // namespace ost::platform

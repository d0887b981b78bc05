#pragma once

#include "platform/base/OSTError.h"

#include <algorithm>
#include <array>
#include <cerrno>

namespace ost::platform {

/// Whether a failure to look at an item says something about the item: it is not there, or it is not what was looked
/// for. Any other reason passes, such as a want of descriptors or memory: nothing is concluded from it, or remembered.
[[nodiscard]] constexpr bool speaksOfTheItem(int errnoValue) {
    constexpr std::array reasons{ENOENT, ENOTDIR, ELOOP, EISDIR, EINVAL, EFBIG, ENXIO, ENODEV, ENAMETOOLONG};
    return std::ranges::find(reasons, errnoValue) != reasons.end();
}

/// Whether an errno is at the root of an error, and is that of a reason that passes.
[[nodiscard]] inline bool isReasonThatPasses(const OSTError& error) {
    const OSTError* root = &error;
    while (root->underlyingError())
        root = root->underlyingError().get();
    return root->domain() == OSTError::Domain::posix && !speaksOfTheItem(static_cast<int>(root->code()));
}

/// Whether the root of an error is that an item is not there.
[[nodiscard]] inline bool isAbsence(const OSTError& error) {
    const OSTError* root = &error;
    while (root->underlyingError())
        root = root->underlyingError().get();
    return root->isPOSIX(ENOENT) || root->isPOSIX(ENOTDIR);
}

} // namespace ost::platform

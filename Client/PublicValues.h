#pragma once

#include "Client/Containers.h"
#include "Client/include/ostrand/ostrand.h"
#include "platform/base/OSTValue.h"

namespace ostrand {

// Between what the public header shows and what the library works with. These may throw for want of memory.

[[nodiscard]] ost::OSTValue privateValue(const v1::Value& value);
[[nodiscard]] ost::OSTDictionary privateDictionary(const v1::Dictionary& dictionary);
[[nodiscard]] v1::Value publicValue(const ost::OSTValue& value);
[[nodiscard]] v1::Dictionary publicDictionary(const ost::OSTDictionary& dictionary);

[[nodiscard]] ContainerRequest privateRequest(const v1::ContainerName& name);
/// Fails with EINVAL for a UUID that is none.
[[nodiscard]] Result<ContainerReference> privateReference(const v1::ContainerReference& container);

[[nodiscard]] v1::Error publicError(const Error& error);

} // namespace ostrand

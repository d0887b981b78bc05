#pragma once

#include <span>
#include <string>
#include <string_view>

namespace ostrand::ctl {

/// "; did you mean \"create\"?" when one of the candidates is near a mistyped word or is the only one that contains it,
/// else nothing. Case plays no part.
[[nodiscard]] std::string didYouMean(std::string_view word, std::span<const std::string> candidates);

} // namespace ostrand::ctl

#pragma once

#include <string>
#include <vector>

namespace ost::test {

/// What is wrong with the JSON that a command line of `ostrandctl` printed: how it differs from the form that the
/// command table promises. Empty when nothing is.
[[nodiscard]] std::string faultOfJSON(const std::vector<std::string>& words, const std::string& output);

} // namespace ost::test

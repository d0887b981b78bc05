#pragma once

#include <filesystem>
#include <functional>

namespace ost::benchmarks {

/// Runs work in a process whose root directory is the image, and gives the seconds that the work says it took.
double secondsInside(const std::filesystem::path& image, const std::function<double()>& work);

} // namespace ost::benchmarks

#pragma once

#include <filesystem>

namespace ost::benchmarks {

inline constexpr unsigned directoriesOfLargeTree = 1000;
inline constexpr unsigned filesOfLargeTree = 100'000;

/// Makes a directory whose sub-directories hold as many files each, all of them empty.
void makeLargeTree(const std::filesystem::path& path);

} // namespace ost::benchmarks

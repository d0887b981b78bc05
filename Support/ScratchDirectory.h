#pragma once

#include <filesystem>

namespace ost::test {

/// A new directory, on memory where the host has such a file system, that is gone some moments after this process is,
/// however that ends. What is mounted there stays as it is. Nobody but root passes through it unless `mode` says so.
std::filesystem::path makeScratchDirectory(unsigned mode = 0700);

} // namespace ost::test

#pragma once

#include <filesystem>

namespace ost::test {

/// A new directory, on memory where the host has such a file system, that is gone some moments after the test process
/// is, however that ends. Nobody but root passes through it unless `mode` says so.
std::filesystem::path makeScratchDirectory(unsigned mode = 0700);

} // namespace ost::test

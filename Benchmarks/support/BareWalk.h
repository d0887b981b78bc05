#pragma once

#include <filesystem>
#include <functional>

namespace ost::benchmarks {

/// A walk with the fewest system calls, for what is done to whole trees.
struct BareWalk {
    /// Anything but a directory, by its name in one.
    std::function<void(int directory, const char* name)> item;
    /// A directory that is open for reading, the top included, before what it holds.
    std::function<void(int directory)> directory;

    void run(const std::filesystem::path& top) const;

    /// One that opens what is no directory, too.
    [[nodiscard]] static BareWalk opening(const std::function<void(int item)>& toFile,
                                          const std::function<void(int directory)>& toDirectory);
};

} // namespace ost::benchmarks

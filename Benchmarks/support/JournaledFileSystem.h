#pragma once

#include "platform/base/FileDescriptor.h"

#include <filesystem>

namespace ost::benchmarks {

/// A new ext4 with a journal, mounted where only the benchmark sees it. It lies in a nameless sparse file on the host's
/// disk, behind a loop device that does not cache: what is synchronised costs what it costs on that disk.
///
/// Both file and loop device are gone once nobody uses the mount any more.
class JournaledFileSystem {
public:
    JournaledFileSystem();
    JournaledFileSystem(const JournaledFileSystem&) = delete;
    JournaledFileSystem& operator=(const JournaledFileSystem&) = delete;
    /// Processes that were started while it was mounted must have ended.
    ~JournaledFileSystem();

    [[nodiscard]] const std::filesystem::path& path() const { return _path; }

private:
    std::filesystem::path _path;
};

} // namespace ost::benchmarks

#pragma once

#include "platform/base/FileDescriptor.h"

#include <atomic>
#include <cstdint>
#include <filesystem>
#include <string>
#include <thread>

namespace ost::test {

/// A file system with one file, "program", which this process serves with the help of FUSE until it stops to answer.
/// What waits for an answer then waits until the object goes.
class ServedFileSystem {
public:
    /// Serves a copy of `program`. `mountedByUser` mounts it the way that users' mounts are made.
    ServedFileSystem(const std::filesystem::path& program, bool mountedByUser);
    ServedFileSystem(const ServedFileSystem&) = delete;
    ServedFileSystem& operator=(const ServedFileSystem&) = delete;
    ~ServedFileSystem();

    [[nodiscard]] std::filesystem::path program() const { return _directory / "program"; }

    void stopAnswering();
    /// Takes it out of the tree; those who use it keep it.
    void detach() const;

private:
    void _serve();
    void _answer(const std::string& request);
    void _reply(std::uint64_t unique, int error, const void* body, std::size_t size) const;

    const std::string _content;
    const std::filesystem::path _directory;
    platform::FileDescriptor _device;
    platform::FileDescriptor _stop;
    std::thread _server;
};

} // namespace ost::test

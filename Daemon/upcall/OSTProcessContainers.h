#pragma once

#include "platform/base/FileDescriptor.h"

#include <cstddef>
#include <cstdint>
#include <expected>
#include <span>

namespace ost {

/// Return codes of an upcall that is not answered; 0 stands for an answer.
inline constexpr std::int32_t OSTUpcallUnexpectedValue = 4;
inline constexpr std::int32_t OSTUpcallRefused = 5; ///< a sender that is not the kernel, an item that cannot be read
inline constexpr std::int32_t OSTUpcallNoBuffer = 9;

/// The pack buffer that answers an upcall, as sealed memory.
struct OSTUpcallAnswer {
    platform::FileDescriptor region;
    std::uint32_t size;
};

/// Tells which containers a process gets that is about to start, and makes those that are missing; these have reached
/// the disk. `request` and the answer are pack buffers, whose items docs/protocol.md lists. When one container cannot
/// be had, the answer says so and names no path. Nothing is looked up for a request that cannot be read.
///
/// Threads: the main queue's. Fails with a return code: one of the above, or the errno of the answer's memory.
[[nodiscard]] std::expected<OSTUpcallAnswer, std::int32_t> server_get_process_containers(std::span<std::byte> request);

} // namespace ost

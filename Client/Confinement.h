#pragma once

#include "platform/base/FileDescriptor.h"

#include <cstdint>
#include <expected>

namespace ostrand {

/// What a confined process may do with the files below a directory, or with one file.
enum class FileAccess : std::uint8_t {
    readAndExecute,
    read,
    readAndWrite, ///< existing files, devices among them, with their controls
    own,          ///< read, write, make, move, link and remove; not execute
};

/// A domain of the kernel's Landlock in the making: a process that enters it, and everything that it starts, can open
/// only the files that were allowed, can send signals and connect to abstract sockets only within the domain, and trace
/// only what is in it. Rights that the running kernel does not know yet are left out: see docs/operations.md.
///
/// Threads: one at a time. Ownership: owns the rules; move-only. Errors: errno.
class Confinement {
public:
    /// The version of the kernel's Landlock; 0 where it has none or has it switched off.
    [[nodiscard]] static int version();

    /// Begins a domain in which nothing is allowed. Fails with EOPNOTSUPP where the kernel has no Landlock.
    [[nodiscard]] static std::expected<Confinement, ost::platform::Errno> create();

    /// Allows access below an open directory, or to an open file. Any kind of descriptor will do.
    [[nodiscard]] std::expected<void, ost::platform::Errno> allow(int file, FileAccess access);

    /// Puts the calling thread into the domain, for good. It must have given up gaining privileges. Needs no memory, so
    /// that it may follow a fork.
    [[nodiscard]] std::expected<void, ost::platform::Errno> enter() const noexcept;

private:
    Confinement(ost::platform::FileDescriptor rules, std::uint64_t handled)
        : _rules(std::move(rules)), _handled(handled) {}

    ost::platform::FileDescriptor _rules;
    std::uint64_t _handled; ///< rights that the kernel knows
};

} // namespace ostrand

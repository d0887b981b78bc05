#pragma once

#include "platform/base/FileDescriptor.h"

#include <link.h>

#include <cstdint>
#include <span>

namespace ost::platform {

/// The functions of this program, as the symbol table of its own file names them. A program that was stripped, or whose
/// file cannot be opened, has none.
///
/// Needs no memory but the stack, so that it serves where memory has run out. Threads: one at a time.
class ProgramSymbols {
public:
    ProgramSymbols();

    /// An address of the program and the function that it lies in.
    struct Location {
        std::uintptr_t address = 0;
        ElfW(Word) name = 0;       ///< where the name stands; 0 when no function was found
        std::uintptr_t offset = 0; ///< of the address in the function
    };

    /// Finds the function of each location. Goes through the table once.
    void find(std::span<Location> locations) const;

    /// Puts the name of a location's function into `buffer`, as the compiler made it and ended by a NUL. Gives false
    /// when the location has none or it does not fit.
    [[nodiscard]] bool readName(const Location& location, std::span<char> buffer) const;

private:
    [[nodiscard]] bool _findTables();

    FileDescriptor _file;
    std::uintptr_t _loadAddress; ///< what is added to the table's addresses
    ElfW(Shdr) _symbols {};      ///< the section of the symbol table; empty when there is none
    ElfW(Shdr) _names {};        ///< the section of its names
};

} // namespace ost::platform

#include "platform/base/ProgramSymbols.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstring>

namespace ost::platform {

namespace {

/// Reads at an offset of the file; gives the number of bytes, 0 on a failure.
std::size_t readAt(const FileDescriptor& file, std::uint64_t offset, std::span<std::byte> bytes) {
    const auto count = ::pread(file.get(), bytes.data(), bytes.size(), static_cast<off_t>(offset));
    return count < 0 ? 0 : static_cast<std::size_t>(count);
}

template<typename T>
bool readWhole(const FileDescriptor& file, std::uint64_t offset, T& value) {
    return readAt(file, offset, std::as_writable_bytes(std::span(&value, 1))) == sizeof value;
}

/// The program itself is the first of the loaded objects.
std::uintptr_t loadAddressOfProgram() {
    std::uintptr_t address = 0;
    const auto takeFirst = [](dl_phdr_info* info, std::size_t, void* result) {
        *static_cast<std::uintptr_t*>(result) = info->dlpi_addr;
        return 1;
    };
    ::dl_iterate_phdr(takeFirst, &address);
    return address;
}

bool isOfThisMachine(const ElfW(Ehdr) & header) {
    constexpr unsigned char ownClass = sizeof(void*) == 8 ? ELFCLASS64 : ELFCLASS32;
    return std::memcmp(header.e_ident, ELFMAG, SELFMAG) == 0 && header.e_ident[EI_CLASS] == ownClass &&
           header.e_shentsize == sizeof(ElfW(Shdr));
}

bool isFunction(const ElfW(Sym) & symbol) {
    return (symbol.st_info & 0xf) == STT_FUNC && symbol.st_shndx != SHN_UNDEF && symbol.st_name != 0;
}

} // namespace

ProgramSymbols::ProgramSymbols()
    : _file(::open("/proc/self/exe", O_RDONLY | O_CLOEXEC)), _loadAddress(loadAddressOfProgram()) {
    if (!_file || !_findTables())
        _symbols = {};
}

bool ProgramSymbols::_findTables() {
    ElfW(Ehdr) header;
    if (!readWhole(_file, 0, header) || !isOfThisMachine(header))
        return false;
    const auto readSection = [&](std::size_t index, ElfW(Shdr) & section) {
        return index < header.e_shnum && readWhole(_file, header.e_shoff + index * sizeof section, section);
    };
    for (std::size_t index = 0; readSection(index, _symbols); ++index)
        if (_symbols.sh_type == SHT_SYMTAB)
            return _symbols.sh_entsize == sizeof(ElfW(Sym)) && readSection(_symbols.sh_link, _names) &&
                   _names.sh_type == SHT_STRTAB;
    return false;
}

void ProgramSymbols::find(std::span<Location> locations) const {
    std::array<ElfW(Sym), 128> symbols;
    for (std::uint64_t done = 0; done < _symbols.sh_size;) {
        const auto wanted = std::min<std::uint64_t>(sizeof symbols, _symbols.sh_size - done);
        const auto bytes = std::as_writable_bytes(std::span(symbols)).first(wanted);
        const auto count = readAt(_file, _symbols.sh_offset + done, bytes) / sizeof symbols[0];
        if (count == 0)
            return;
        done += count * sizeof symbols[0];
        for (const auto& symbol : std::span(symbols).first(count))
            for (auto& location : locations) {
                const auto offset = location.address - _loadAddress - symbol.st_value;
                if (offset < symbol.st_size && isFunction(symbol)) {
                    location.name = symbol.st_name;
                    location.offset = offset;
                }
            }
    }
}

bool ProgramSymbols::readName(const Location& location, std::span<char> buffer) const {
    if (location.name == 0 || location.name >= _names.sh_size)
        return false;
    const auto longest = std::min<std::uint64_t>(buffer.size(), _names.sh_size - location.name);
    const auto count = readAt(_file, _names.sh_offset + location.name, std::as_writable_bytes(buffer.first(longest)));
    return std::ranges::find(buffer.first(count), '\0') != buffer.begin() + static_cast<std::ptrdiff_t>(count);
}

} // namespace ost::platform

#pragma once

#include <string>

namespace ost::platform {

/// The errno by which something of the operating system failed. Is an int wherever the system wants one; in a message
/// it prints its number for `%d` and its text for every other placeholder.
class Errno {
public:
    constexpr Errno(int value) : _value(value) {}
    constexpr operator int() const { return _value; }

    /// "No such file or directory"
    [[nodiscard]] std::string description() const;

private:
    int _value;
};

} // namespace ost::platform
